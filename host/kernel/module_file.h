/* What a module file says about itself, read with libelf without mapping it. */
#pragma once

#include <cstdint>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <vector>

namespace host {

/* A file that is no module, or a module that cannot be loaded: what() says which file, what is
 * wrong and what to do. */
struct ModuleError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

constexpr uint32_t kParameterInt = 1; /* a 32-bit int */

struct ModuleParameter {
  std::string name;
  uint32_t type; /* kParameterInt */
  std::string description;
  uint64_t record; /* the parameter's record, as an address in the file's own numbering */
};
struct ModuleAssertion {
  uint64_t kind; /* 1: not implemented */
  std::string source;
  uint64_t line;
};
struct Namespace {
  std::string name;    /* com.tarvik.karst */
  std::string version; /* 0.0.0.1 */
  bool operator==(const Namespace &) const = default;
};

/* "com.tarvik.karst#0.0.0.1" */
std::string toString(const Namespace &space);

/* The namespaces that stand for platform/: what a host of this project provides itself. */
std::vector<Namespace> platformNamespaces();

class ModuleFile {
 public:
  /* Throws ModuleError unless the file is a module that is whole, in itself consistent (its tables
   * point into it, it defines what it says it exports) and has the loader's two entry points. */
  explicit ModuleFile(const std::filesystem::path &path);

  std::filesystem::path path;
  std::vector<std::string> declaration; /* the strings of .karst.modinfo, in order */
  std::vector<Namespace> provides;
  std::vector<Namespace> required; /* of .karst.required */
  std::vector<ModuleParameter> parameters;
  std::vector<std::string> exports;
  std::vector<ModuleAssertion> assertions;
  std::vector<std::string> dynamicSymbols;   /* that it defines for others, exports among them */
  std::vector<std::string> undefinedSymbols; /* that others must define */

 private:
  void readDeclaration(const class ElfImage &image);
  void readParameters(const ElfImage &image);
  void readExports(const ElfImage &image);
  void readAssertions(const ElfImage &image);
};

}  // namespace host
