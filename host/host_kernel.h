/* The host kernel in user space: everything that platform/ promises, in one object.
 *
 *   host::Kernel kernel;
 *   host::Module &resolver = kernel.modules().load("karst_resolver.so");
 *   kernel.directory().setSelf(...);
 *   kernel.directory().put(...);
 *   kernel.directory().setUsable(true);
 *   kernel.settle();
 *   auto *create = resolver.function<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
 *
 * The platform's functions have no argument that names a kernel, so a process has one at a time.
 */
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "host/directory/directory.h"
#include "host/kernel/module_loader.h"
#include "host/threads/worlds.h"
#include "host/tracing/tracing.h"

namespace host {

struct KernelSettings {
  uint32_t maxAssociations = 1024; /* QXT_GetMaxAssocCount */
  bool witness = false;            /* TOLM_IsWitnessNode */
  DirectorySettings directory;
  TraceSettings tracing;
  WorldSettings worlds;
};

class Kernel {
 public:
  explicit Kernel(const KernelSettings &settings = {});
  ~Kernel(); /* unloads what is loaded; what is left behind afterwards is reported and fatal */
  Kernel(const Kernel &) = delete;
  Kernel &operator=(const Kernel &) = delete;

  static Kernel &current(); /* panics when there is none */

  const KernelSettings &settings() const;
  Directory &directory();
  ModuleLoader &modules();

  /* Returns when all that was told to the directory so far has reached every subscriber and every
   * world has finished what that gave it to do. What a source has yet to notice is not waited for.
   * Not from a callback or a world. */
  void settle();

  /* All that is alive: modules, worlds, locks, domains, heaps and their blocks, subscriptions,
   * logs; a line each. */
  std::vector<std::string> alive() const;

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace host
