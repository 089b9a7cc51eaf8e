/* Loads modules into this process and unloads them.
 *
 * A module's dynamic symbols are visible to the modules that are loaded after it, so it shows only
 * its entry points and its exports and hides the rest (-fvisibility=hidden).
 */
#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "host/kernel/module_file.h"
#include "platform/zel.h"

namespace host {

class Module {
 public:
  ~Module();
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
  friend void keepUnloadedModules(std::function<bool()> outOfReach);
  friend void revealKeptModules();
  struct Impl;
  explicit Module(std::shared_ptr<Impl> impl);
  std::shared_ptr<Impl> impl_;
};

/* Loads and unloads are done one at a time; another thread's waits. init_module and cleanup_module
 * run on the caller's thread and may call neither. */
class ModuleLoader {
 public:
  /* `provided`: the namespaces that this host serves itself. `quiesce`: called after cleanup_module
   * and before unmapping; returns when no thread of the host runs inside the module any more. */
  ModuleLoader(std::vector<Namespace> provided, std::function<void()> quiesce);
  ~ModuleLoader(); /* unloads what is still loaded, last first */

  /* Checks, maps, sets NAME=VALUE parameters, calls init_module. VALUE of an int is decimal or 0x
   * hexadecimal. Before anything is mapped: the namespaces that the module requires are provided,
   * the ones it provides are not, each symbol that it lacks is the program's or an export of a
   * loaded module, and the parameters are its own. Throws ModuleError; then nothing of the module
   * remains. The returned module stays until unload. */
  Module &load(const std::filesystem::path &path, const std::vector<std::string> &parameters = {});

  /* Calls cleanup_module and unmaps. Throws ModuleError when a loaded module requires one of its
   * namespaces or uses its exports, and then changes nothing. */
  void unload(Module &module);

  std::vector<const Module *> modules() const;

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

/* For a program that loads one module again and again: from now on a module stays mapped when it is
 * unloaded, out of reach of everybody, and its next load begins with its variables as the dynamic
 * linker first filled them in. Its init_module and cleanup_module run each time. Not kept are
 * modules with constructors, which run only when they are mapped, and modules that use another.
 * That nobody can reach them takes system calls: `outOfReach` is asked at each unload whether it is
 * worth them; without it, it always is. */
void keepUnloadedModules(std::function<bool()> outOfReach = {});

/* So that the report of a call into a kept module can name what lies there. */
void revealKeptModules();

/* "KARSTResolver_Create+0x42 in karst_resolver.so", or the bare address. Knows loaded modules
 * (their whole symbol tables) and the program. */
std::string symbolize(const void *address);

}  // namespace host
