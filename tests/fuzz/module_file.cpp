/* Any bytes as a module file: refused with a ModuleError, or read without leaving the file. One thread,
 * no lock.
 */
#include "host/kernel/module_file.h"

#include <sys/mman.h>
#include <unistd.h>

#include <string>

#include "host/kernel/elf_image.h"
#include "tests/fuzz/target.h"

namespace {

/* A file in memory alone, the same one for every input. */
class File {
 public:
  File() : descriptor_(memfd_create("fuzzed module", 0)) { FUZZ_REQUIRE(descriptor_ >= 0); }
  ~File() { close(descriptor_); }
  File(const File &) = delete;
  File &operator=(const File &) = delete;

  void write(const uint8_t *data, size_t size) const {
    FUZZ_REQUIRE(ftruncate(descriptor_, 0) == 0);
    FUZZ_REQUIRE(pwrite(descriptor_, data, size, 0) == static_cast<ssize_t>(size));
  }
  std::string path() const { return "/proc/self/fd/" + std::to_string(descriptor_); }

 private:
  const int descriptor_;
};

void readImage(const std::string &path) {
  const host::ElfImage image(path);
  uint64_t sum = image.memorySize();
  for (const host::ElfSymbol &symbol : image.definedSymbols()) sum += symbol.name.size();
  FUZZ_REQUIRE(!image.isWritable(UINT64_MAX - sum % 7, 8));
}

void readModule(const std::string &path) {
  const host::ModuleFile module(path);
  for (const std::string &name : module.exports) FUZZ_REQUIRE(!name.empty());
  FUZZ_REQUIRE(module.dynamicSymbols.size() >= 2); /* the two entry points */
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  static const File file;
  file.write(data, size);
  for (const auto read : {readImage, readModule}) {
    try {
      read(file.path());
    } catch (const host::ModuleError &error) {
      FUZZ_REQUIRE(std::string(error.what()).starts_with(file.path() + ": "));
    }
  }
  return 0;
}
