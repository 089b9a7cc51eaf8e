/* The host kernel with the resolver loaded, as clients of the module find it. Used by the main thread;
 * only WatchedNode's callbacks come on the resolver's own. */
#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "bench/bench.h"
#include "host/host_kernel.h"
#include "karst_resolver/karst_resolver.h"

namespace bench {

struct Cluster {
  Cluster(); /* throws host::ModuleError */

  /* What the module has by this name, exported or not: the code as it is shipped. Throws
   * std::runtime_error. */
  template <typename Type>
  Type *inModule(const char *name) const {
    return reinterpret_cast<Type *>(symbol(name));
  }

  host::Kernel kernel;
  host::Module &module;
  decltype(KARSTResolver_Create) *const create;
  decltype(KARSTResolver_Destroy) *const destroy;
  decltype(KARSTResolver_SetCallback) *const setCallback;
  decltype(KARSTResolver_GetNodeLocators) *const getNodeLocators;

 private:
  void *symbol(const char *name) const;
};

/* A reachable node, with one interface of four addresses, and its instances, at least one. */
class WatchedNode {
 public:
  /* Throws std::runtime_error when an instance cannot be made. */
  WatchedNode(Cluster &cluster, uint8_t number, size_t instances);
  ~WatchedNode();
  WatchedNode(const WatchedNode &) = delete;
  WatchedNode &operator=(const WatchedNode &) = delete;

  KARSTResolverInstance *instance() const { return instances_.front(); }
  size_t instances() const { return instances_.size(); }

  /* The interface's entry with other addresses than before. */
  host::Entry nextChange() { return changes_[changed_++ % 2]; }

  /* Calls of all instances' callbacks so far, and when the first instance was last called. */
  uint64_t calls() const { return calls_; }
  Clock::time_point lastCall() const { return lastCall_; }

 private:
  static void told(void *data, KARSTResolverInstance *instance, uint32_t state);
  static void toldAndTimed(void *data, KARSTResolverInstance *instance, uint32_t state);

  Cluster &cluster_;
  const host::Entry changes_[2];
  size_t changed_ = 0;
  std::vector<KARSTResolverInstance *> instances_;
  std::atomic<uint64_t> calls_{0};
  std::atomic<Clock::time_point> lastCall_{};
};

}  // namespace bench
