/* What a client does most, in the loaded module: reading the locators out, beside the same bytes
 * behind other locks. */
#include <memory>
#include <mutex>
#include <shared_mutex>

#include "bench/subjects.h"

namespace bench {
namespace {

struct NoLock {
  void lock() {}
  void unlock() {}
};

template <typename Mutex, typename Lock>
void readBehind(benchmark::State &state) {
  Mutex mutex;
  KARSTResolverNodeLocators kept{}, read;
  for (auto _ : state) {
    const Lock lock(mutex);
    benchmark::ClobberMemory();
    read = kept;
    benchmark::DoNotOptimize(read);
  }
}

void readOurs(benchmark::State &state, const Cluster &cluster, const WatchedNode &node) {
  KARSTResolverNodeLocators read{};
  read.capacity = KARST_RESOLVER_MAX_LOCATORS;
  for (auto _ : state) {
    cluster.getNodeLocators(node.instance(), &read);
    benchmark::DoNotOptimize(read);
  }
  if (read.count != KARST_RESOLVER_MAX_LOCATORS) state.SkipWithError("not all was read");
}

}  // namespace

void measureReadOut(Cluster &cluster) {
  const auto node = std::make_shared<WatchedNode>(cluster, 2, 1);

  const std::string read = "GetNodeLocators, alone";
  measure({read}, [&cluster, node](auto &state) { readOurs(state, cluster, *node); });
  measure({read, "copy, std::shared_mutex"},
          readBehind<std::shared_mutex, std::shared_lock<std::shared_mutex>>);
  measure({read, "copy, std::mutex"}, readBehind<std::mutex, std::lock_guard<std::mutex>>);
  measure({read, "copy alone"}, readBehind<NoLock, std::lock_guard<NoLock>>);
}

}  // namespace bench
