/* What a client does with an instance, and what a change costs from the directory to the callbacks of
 * all instances of a node, on all threads that it takes. */
#include <stdexcept>

#include "bench/cluster.h"
#include "bench/counts/counts.h"
#include "karst_resolver/instance.h"

namespace bench {
namespace {

constexpr uint8_t NODE = 1;
constexpr size_t CALLS = 1000, CHANGES = 50;

void countCalls(Cluster &cluster, const WatchedNode &node) {
  KARSTResolverInstance *const instance = node.instance();
  const size_t size = node.instances();
  KARSTResolverNodeLocators locators{};
  locators.capacity = KARST_RESOLVER_MAX_LOCATORS;
  count(sized("GetNodeLocators", "instances", size), CALLS, [&] {
    for (size_t i = 0; i < CALLS; i++) cluster.getNodeLocators(instance, &locators);
  });
  count(sized("Create and Destroy", "instances", size), CALLS, [&] {
    for (size_t i = 0; i < CALLS; i++) {
      KARSTResolverInstance *other = nullptr;
      if (cluster.create(&other, 0, zel_UUID{}, locators.nodeUUID, false) != ZEL_OK) {
        throw std::runtime_error("an instance could not be made");
      }
      cluster.destroy(other);
    }
  });
  KARSTResolverInstance *other = nullptr;
  cluster.create(&other, 0, zel_UUID{}, locators.nodeUUID, false);
  const auto callback = [](void *, KARSTResolverInstance *, uint32_t) {};
  count(sized("SetCallback", "instances", size), CALLS, [&] {
    for (size_t i = 0; i < CALLS; i++) cluster.setCallback(other, callback, nullptr);
  });
  cluster.destroy(other);
}

/* Each change reaches each instance once. */
void countChange(Cluster &cluster, WatchedNode &node) {
  count(sized("change to callbacks", "instances", node.instances()), CHANGES, [&] {
    for (size_t i = 0; i < CHANGES; i++) {
      const uint64_t before = node.calls();
      cluster.kernel.directory().put(node.nextChange());
      CALLGRIND_TOGGLE_COLLECT; /* of this thread: how often it looks whether all is done, is chance */
      cluster.kernel.settle();
      CALLGRIND_TOGGLE_COLLECT;
      if (node.calls() != before + node.instances()) {
        throw std::runtime_error("a change did not reach each instance once");
      }
    }
  });
}

void countCapacities(const Cluster &cluster, const WatchedNode &node) {
  for (const uint16_t capacity : {1, 2, 4}) {
    KARSTResolverNodeLocators locators{};
    locators.capacity = capacity;
    count(sized("GetNodeLocators", "capacity", capacity), CALLS, [&] {
      for (size_t i = 0; i < CALLS; i++) cluster.getNodeLocators(node.instance(), &locators);
    });
  }
}

void countSpinlock(const WatchedNode &node) {
  const zel_SpinlockHandle lock = node.instance()->lock.handle;
  count("spinlock: lock and unlock", CALLS, [&] {
    for (size_t i = 0; i < CALLS; i++) {
      zel_SpinlockLock(lock);
      zel_SpinlockUnlock(lock);
    }
  });
}

}  // namespace

void countInstances() {
  Cluster cluster;
  {
    const WatchedNode node(cluster, NODE, 1);
    countSpinlock(node);
    countCapacities(cluster, node);
  }
  for (const size_t instances : {1, 128, 1024}) {
    WatchedNode node(cluster, NODE, instances);
    countCalls(cluster, node);
    countChange(cluster, node);
  }
}

}  // namespace bench
