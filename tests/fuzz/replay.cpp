/* Plays kept inputs through a fuzz target, without a fuzzer: the files that are named, and the files of
 * the folders that are named. One thread, no lock.
 */
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>
#include <string>

#include "tests/fuzz/target.h"

int main(int argc, char **argv) {
  std::set<std::filesystem::path> inputs;
  for (int i = 1; i < argc; i++) {
    if (std::filesystem::is_directory(argv[i])) {
      inputs.insert(std::filesystem::directory_iterator(argv[i]), {});
    } else {
      inputs.insert(argv[i]);
    }
  }
  for (const auto &path : inputs) {
    std::ifstream file(path, std::ios::binary);
    const std::string bytes{std::istreambuf_iterator<char>(file), {}};
    std::printf("%s: %zu bytes\n", path.c_str(), bytes.size());
    std::fflush(stdout);
    if (!file) return 1;
    LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(bytes.data()), bytes.size());
  }
  return inputs.empty() ? 1 : 0;
}
