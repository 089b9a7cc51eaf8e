/* The host kernel with the resolver loaded, as clients of the module find it, and a directory as full
 * as the resolver's cache can hold. Used by the main thread; only WatchedNode's callbacks come on the
 * resolver's own. */
#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "bench/clock.h"
#include "host/host_kernel.h"
#include "host/kernel/heap.h"
#include "karst_resolver/karst_resolver.h"

namespace bench {

/* The directory's entries: reachable nodes with healthy interfaces of four addresses each. */
inline constexpr uint8_t NODES = 128, INTERFACES_OF_A_NODE = 4;
zel_UUID nodeUUID(uint8_t node);
zel_UUID interfaceUUID(uint8_t node, uint8_t interface);
host::Entry nodeEntry(uint8_t node);
host::Entry interfaceEntry(uint8_t node, uint8_t interface, uint8_t version); /* of the addresses */
host::Entry healthEntry(uint8_t node, uint8_t interface);

struct Cluster {
  explicit Cluster(uint8_t nodes = NODES); /* throws host::ModuleError */

  /* Blocks that the module has ever asked its heap for. */
  uint64_t allocations() const { return heap().allocations; }
  host::HeapState heap() const;

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

/* A node of the cluster's and instances for it, at least one. */
class WatchedNode {
 public:
  /* Throws std::runtime_error when an instance cannot be made. */
  WatchedNode(Cluster &cluster, uint8_t number, size_t instances);
  ~WatchedNode();
  WatchedNode(const WatchedNode &) = delete;
  WatchedNode &operator=(const WatchedNode &) = delete;

  KARSTResolverInstance *instance() const { return instances_.front(); }
  size_t instances() const { return instances_.size(); }

  /* The entry of the first interface with other addresses than before. */
  host::Entry nextChange() { return changes_[changed_++ % 2]; }

  /* Tells the directory of one change and waits until all has settled; `start` is when it was told.
   * False when not each instance was called once. */
  bool change(Clock::time_point *start);

  /* Calls of all instances' callbacks so far, when the first instance was last called, and how much
   * time was between the calls of the first and of the last instance of the list. */
  uint64_t calls() const { return calls_; }
  Clock::time_point lastCall() const { return first_; }
  Clock::duration span() const;

 private:
  static void told(void *data, KARSTResolverInstance *instance, uint32_t state);
  static void toldAndTimed(void *data, KARSTResolverInstance *instance, uint32_t state);

  Cluster &cluster_;
  const host::Entry changes_[2];
  size_t changed_ = 0;
  std::vector<KARSTResolverInstance *> instances_;
  std::atomic<uint64_t> calls_{0};
  std::atomic<Clock::time_point> first_{}, last_{}; /* calls of the first and the last instance */
};

}  // namespace bench
