/* The sections that a module declares itself with. No state shared, no lock. */
#include "host/kernel/module_file.h"

#include <algorithm>
#include <string_view>

#include "host/kernel/elf_image.h"
#include "host/kernel/text.h"

namespace host {
namespace {

constexpr uint64_t kWordSize = 8;
constexpr uint64_t kParameterRecordSize = 40;
constexpr uint64_t kParameterTypeOffset = 8;
constexpr uint64_t kParameterVariableOffset = 16;
constexpr uint64_t kExportRecordSize = 16;
constexpr uint64_t kAssertionRecordSize = 24;

constexpr std::string_view kProvides = "nsProvides=";
constexpr std::string_view kParameterDescription = "param_desc_";

ElfSection neededSection(const ElfImage &image, const char *name) {
  const auto section = image.section(name);
  if (!section) image.refuse(formatText("has no section %s: it is no kernel module", name));
  return *section;
}

/* The strings that lie back to back in a section. */
std::vector<std::string> stringsOf(const ElfImage &image, const char *sectionName) {
  std::string_view rest = neededSection(image, sectionName).bytes;
  std::vector<std::string> strings;
  while (!rest.empty()) {
    const size_t length = rest.find('\0');
    if (length == std::string_view::npos) {
      image.refuse(formatText("the last string of %s does not end; build it again", sectionName));
    }
    /* Compilers align long arrays: zero bytes between strings are no strings. */
    if (length != 0) strings.emplace_back(rest.substr(0, length));
    rest.remove_prefix(length + 1);
  }
  return strings;
}

/* The addresses of a table's records; none when the file lacks the section. */
std::vector<uint64_t> recordsOf(const ElfImage &image, const char *sectionName, uint64_t size) {
  std::vector<uint64_t> addresses;
  const auto section = image.section(sectionName);
  if (!section) return addresses;
  if (section->bytes.size() % size != 0) {
    image.refuse(formatText("the size of %s is no multiple of %zu bytes; declare whole records",
                            sectionName, static_cast<size_t>(size)));
  }
  for (uint64_t offset = 0; offset < section->bytes.size(); offset += size) {
    addresses.push_back(section->address + offset);
  }
  return addresses;
}

Namespace parseNamespace(const ElfImage &image, const std::string &text) {
  const size_t mark = text.find('#');
  if (mark == std::string::npos || mark == 0 || mark + 1 == text.size()) {
    image.refuse("\"" + text + "\" is no namespace; write NAME#VERSION");
  }
  return {text.substr(0, mark), text.substr(mark + 1)};
}

bool contains(const std::vector<std::string> &names, const std::string &name) {
  return std::find(names.begin(), names.end(), name) != names.end();
}

/* "param_desc_NAME=text" of the declaration; empty when there is none. */
std::string descriptionOf(const std::vector<std::string> &declaration, const std::string &name) {
  const std::string prefix = std::string(kParameterDescription) + name + "=";
  for (const std::string &line : declaration) {
    if (line.starts_with(prefix)) return line.substr(prefix.size());
  }
  return {};
}

}  // namespace

std::string toString(const Namespace &space) {
  return space.name + "#" + space.version;
}

ModuleFile::ModuleFile(const std::filesystem::path &filePath) : path(filePath) {
  const ElfImage image(filePath);
  dynamicSymbols = image.dynamicSymbols();
  undefinedSymbols = image.undefinedSymbols();
  readDeclaration(image);
  readParameters(image);
  readExports(image);
  readAssertions(image);
  for (const char *entry : {"init_module", "cleanup_module"}) {
    if (!contains(dynamicSymbols, entry)) {
      image.refuse(formatText("does not define %s for the loader; define and export it", entry));
    }
  }
}

void ModuleFile::readDeclaration(const ElfImage &image) {
  declaration = stringsOf(image, ".karst.modinfo");
  for (const std::string &line : declaration) {
    if (line.starts_with(kProvides)) {
      provides.push_back(parseNamespace(image, line.substr(kProvides.size())));
    }
  }
  for (const std::string &text : stringsOf(image, ".karst.required")) {
    required.push_back(parseNamespace(image, text));
  }
}

void ModuleFile::readParameters(const ElfImage &image) {
  for (const uint64_t record : recordsOf(image, ".karst.params", kParameterRecordSize)) {
    ModuleParameter parameter;
    parameter.record = record;
    parameter.name = image.stringAt(image.wordAt(record));
    parameter.type = static_cast<uint32_t>(image.wordAt(record + kParameterTypeOffset));
    parameter.description = descriptionOf(declaration, parameter.name);
    if (!image.isWritable(image.wordAt(record + kParameterVariableOffset), sizeof(int32_t))) {
      image.refuse("the variable of parameter " + parameter.name +
                   " cannot be written; make it a plain variable of the module");
    }
    parameters.push_back(std::move(parameter));
  }
}

void ModuleFile::readExports(const ElfImage &image) {
  for (const uint64_t record : recordsOf(image, ".karst.exports", kExportRecordSize)) {
    std::string symbol = image.stringAt(image.wordAt(record));
    if (!contains(dynamicSymbols, symbol)) {
      image.refuse("exports " + symbol +
                   ", which it does not define; define it, visible to others");
    }
    exports.push_back(std::move(symbol));
  }
}

void ModuleFile::readAssertions(const ElfImage &image) {
  for (const uint64_t record : recordsOf(image, ".karst.asserts", kAssertionRecordSize)) {
    assertions.push_back({image.wordAt(record), image.stringAt(image.wordAt(record + kWordSize)),
                          image.wordAt(record + 2 * kWordSize)});
  }
}

std::vector<Namespace> platformNamespaces() {
  return {
      {"com.tarvik.tracing", "0.0.0.1"},          {"com.tarvik.qxt", "0.0.0.1"},
      {"com.tarvik.tolmutil", "0.0.0.1"},         {"com.tarvik.karst", "0.0.0.1"},
      {"com.tarvik.tolmapi", "0.0.0.2"},          {"com.tarvik.zelapi", "v2_4_0_0"},
      {"com.tarvik.zelapi.incompat", "v2_4_0_0"},
  };
}

}  // namespace host
