/* Loads modules into this process and unloads them. */
#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "host/kernel/module_file.h"
#include "platform/zel.h"

namespace host {

class Module {
 public:
  const std::string &name() const;
  const ModuleFile &file() const;
  zel_ModuleID id() const;

  /* An exported symbol; null when the module does not export it. */
  void *exported(const std::string &symbol) const;
  template <typename Function>
  Function *function(const std::string &symbol) const {
    return reinterpret_cast<Function *>(exported(symbol));
  }

  /* Any symbol of the file's symbol table, exported or not; null when there is none. For reports,
   * tests and debuggers, never for clients. */
  void *anySymbol(const std::string &symbol) const;

 private:
  friend class ModuleLoader;
  struct Impl;
  explicit Module(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;

 public:
  ~Module();
};

class ModuleLoader {
 public:
  /* `provided`: the namespaces that this host serves itself. `quiesce`: called after cleanup_module
   * and before unmapping; returns when no thread of the host runs inside the module any more. */
  ModuleLoader(std::vector<Namespace> provided, std::function<void()> quiesce);
  ~ModuleLoader(); /* unloads what is still loaded, last first */

  /* Maps, checks, sets NAME=VALUE parameters, calls init_module. Throws ModuleError; then nothing of
   * the module remains. The returned module stays until unload. */
  Module &load(const std::filesystem::path &path, const std::vector<std::string> &parameters = {});

  /* Calls cleanup_module and unmaps. Throws ModuleError when a loaded module uses its exports. */
  void unload(Module &module);

  std::vector<const Module *> modules() const;

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

/* "KARSTResolver_Create+0x42 in karst_resolver.so", or the bare address. Knows loaded modules (their
 * whole symbol tables) and the program. */
std::string symbolize(const void *address);

}  // namespace host
