/* What a module file says about itself, read with libelf without mapping it. */
#pragma once

#include <cstdint>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <vector>

namespace host {

/* A file that is no module, or a module that cannot be loaded: what() says which file, what is wrong
 * and what to do. */
struct ModuleError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct ModuleParameter {
  std::string name;
  uint32_t type; /* 1: 32-bit int */
  std::string description;
};
struct ModuleAssertion {
  uint64_t kind; /* 1: not implemented */
  std::string source;
  uint64_t line;
};
struct Namespace {
  std::string name;    /* com.tarvik.karst */
  std::string version; /* 0.0.0.1 */
};

class ModuleFile {
 public:
  explicit ModuleFile(const std::filesystem::path &path); /* throws ModuleError */

  std::filesystem::path path;
  std::vector<std::string> declaration; /* the strings of .karst.modinfo, in order */
  std::vector<Namespace> provides;
  std::vector<Namespace> required; /* of .karst.required */
  std::vector<ModuleParameter> parameters;
  std::vector<std::string> exports;
  std::vector<ModuleAssertion> assertions;
  std::vector<std::string> undefinedSymbols;
};

}  // namespace host
