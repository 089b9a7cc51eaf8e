/* How the rate of reading grows with the readers: of one instance, whose lock they share, and of an
 * instance each. */
#include <atomic>
#include <barrier>
#include <thread>

#include "bench/bench.h"
#include "bench/growth/series.h"
#include "bench/growth/watched.h"

namespace growth {
namespace {

using bench::Clock;
using bench::Cluster;

constexpr unsigned ROUNDS = 15, MOST_READERS = 8;
constexpr auto TIME = std::chrono::milliseconds(40);

/* Readings a second of all readers together. */
double rate(const Cluster &cluster, const WatchedNodes &nodes, unsigned readers, bool same) {
  std::atomic<bool> ending{false};
  std::atomic<uint64_t> readings{0};
  std::barrier together(readers + 1);
  std::vector<std::jthread> threads;
  for (unsigned i = 0; i < readers; i++) {
    threads.emplace_back([&, i] {
      bench::pin(i);
      KARSTResolverInstance *const instance = nodes.each[same ? 0 : i]->instance();
      KARSTResolverNodeLocators read{};
      read.capacity = KARST_RESOLVER_MAX_LOCATORS;
      uint64_t mine = 0;
      together.arrive_and_wait();
      for (; !ending.load(std::memory_order_relaxed); mine++) {
        cluster.getNodeLocators(instance, &read);
        benchmark::DoNotOptimize(read);
      }
      readings += mine;
    });
  }
  bench::unpin();
  together.arrive_and_wait();
  const Clock::time_point start = Clock::now();
  std::this_thread::sleep_for(TIME);
  ending = true;
  const double taken = nanoseconds(Clock::now() - start) * 1e-9;
  threads.clear();
  return static_cast<double>(readings) / taken;
}

}  // namespace

Series growReaders() {
  Cluster cluster;
  const WatchedNodes nodes(cluster, MOST_READERS);
  Series series{"readers",
                "threads",
                {{"of one instance", "1/s"},
                 {"of one, a reader", "1/s"},
                 {"one instance each", "1/s"},
                 {"one each, a reader", "1/s"}},
                {}};
  sample(series, {1, 2, 3, 4, 5, 6, 7, 8}, ROUNDS, [&](double at) -> std::vector<double> {
    const auto readers = static_cast<unsigned>(at);
    const double same = rate(cluster, nodes, readers, true);
    const double each = rate(cluster, nodes, readers, false);
    return {same, same / at, each, each / at};
  });
  return series;
}

}  // namespace growth
