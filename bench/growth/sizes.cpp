/* How cost grows with the cluster, nodes and interfaces, and with the instances of its clients. */
#include <stdexcept>

#include "bench/bench.h"
#include "bench/growth/series.h"
#include "bench/growth/watched.h"
#include "karst_resolver/model.h"

namespace growth {
namespace {

using bench::Clock;
using bench::Cluster;
using bench::WatchedNode;

constexpr unsigned ROUNDS = 15, TURNS = 9, MANY_TURNS = 2001;
constexpr unsigned MOST_INTERFACES = bench::NODES * bench::INTERFACES_OF_A_NODE;
constexpr Clock::duration LEAST_TIME = std::chrono::milliseconds(1);

/* ---- A cluster of any size ------------------------------------------------------------------- */

/* Leaves so many nodes and interfaces in the directory. The first node has the first `together`
 * interfaces, the second the next ones, and so on. */
void resize(Cluster &cluster, unsigned nodes, unsigned interfaces,
            unsigned together = bench::INTERFACES_OF_A_NODE) {
  host::Directory &directory = cluster.kernel.directory();
  for (uint8_t i = 0; i < bench::NODES; i++) {
    if (i < nodes) {
      directory.put(bench::nodeEntry(i));
    } else {
      directory.remove(KARST_TYPE_NODE, bench::nodeUUID(i));
    }
  }
  for (unsigned i = 0; i < MOST_INTERFACES; i++) {
    const auto node = static_cast<uint8_t>(i / bench::INTERFACES_OF_A_NODE);
    const auto number = static_cast<uint8_t>(i % bench::INTERFACES_OF_A_NODE);
    if (i < interfaces) {
      host::Entry entry = bench::interfaceEntry(node, number, 0);
      entry.owner = bench::nodeUUID(static_cast<uint8_t>(i / together));
      directory.put(std::move(entry));
      directory.put(bench::healthEntry(node, number));
    } else {
      directory.remove(KARST_TYPE_NET_INTERFACE, bench::interfaceUUID(node, number));
      directory.remove(KARST_TYPE_HEALTH_STATUS, bench::interfaceUUID(node, number));
    }
  }
  cluster.kernel.settle();
}

/* ---- What is timed --------------------------------------------------------------------------- */

/* What the directory makes the module do when it says that changes were lost, and none were.
 * Repeated until it takes long enough for the clock. */
double rescan(Cluster &cluster) {
  using Callback = zel_Status(void *, const KarstEntryHeader *, void *, zel_Status);
  auto *nodesCalled = cluster.inModule<Callback>("KARSTResolverNodeSubCbk");
  auto *interfacesCalled = cluster.inModule<Callback>("KARSTResolverNetIfSubCbk");
  auto *cache = *cluster.inModule<KARSTResolverCache *>("karstResolverCache");
  const KarstEntryHeader none{};
  const Clock::time_point start = Clock::now();
  Clock::duration taken{};
  unsigned times = 0;
  for (; taken < LEAST_TIME; times++) {
    nodesCalled(cache, &none, nullptr, ZEL_SUB_RESYNC);
    interfacesCalled(cache, &none, nullptr, ZEL_SUB_RESYNC);
    taken = Clock::now() - start;
  }
  return nanoseconds(taken) / times;
}

/* From an unusable directory that becomes usable to the last callback. */
double enable(Cluster &cluster, const WatchedNodes &watched) {
  cluster.kernel.directory().setUsable(false);
  cluster.kernel.settle();
  const uint64_t before = watched.calls();
  const Clock::time_point start = Clock::now();
  cluster.kernel.directory().setUsable(true);
  cluster.kernel.settle();
  if (watched.calls() < before + watched.each.size()) {
    throw std::runtime_error("enable: not each instance was called");
  }
  return nanoseconds(watched.lastCall() - start);
}

/* From a change of the node to the callback of its first instance. */
double event(WatchedNode &node) {
  Clock::time_point start;
  if (!node.change(&start)) throw std::runtime_error("a change: not each instance called once");
  return nanoseconds(node.lastCall() - start);
}

}  // namespace

/* ---- The axes -------------------------------------------------------------------------------- */

Series growNodes() {
  Cluster cluster;
  bench::pin(0);
  Series series{
      "nodes",
      "nodes",
      {{"rescan", "ns"}, {"rescan, an entry", "ns"}, {"enable", "ns"}, {"enable, an entry", "ns"}},
      {}};
  sample(series, {1, 2, 4, 8, 16, 32, 64, 128}, ROUNDS, [&](double at) -> std::vector<double> {
    const auto nodes = static_cast<unsigned>(at);
    const double entries = at * (1 + bench::INTERFACES_OF_A_NODE);
    resize(cluster, nodes, nodes * bench::INTERFACES_OF_A_NODE);
    const WatchedNodes watched(cluster, nodes);
    const double unchanged = rescan(cluster);
    const bench::OthersPinned pinned(1);
    const double cold = medianOf(3, [&] { return enable(cluster, watched); });
    return {unchanged, unchanged / entries, cold, cold / entries};
  });
  bench::unpin();
  return series;
}

/* 128 nodes are there all along. The worst case is one node that has all interfaces: it looks for
 * each one among all of its own. */
Series growInterfaces() {
  Cluster cluster;
  bench::pin(0);
  Series series{"interfaces",
                "interfaces",
                {{"rescan, 4 a node", "ns"},
                 {"rescan, all of one node", "ns"},
                 {"change, 4 a node", "ns"},
                 {"change, all of one node", "ns"}},
                {}};
  const auto one = [&](unsigned interfaces, unsigned together) {
    resize(cluster, bench::NODES, 0);
    resize(cluster, bench::NODES, interfaces, together);
    WatchedNode node(cluster, 0, 1);
    const double unchanged = rescan(cluster);
    const bench::OthersPinned pinned(0);
    return std::pair(unchanged, medianOf(MANY_TURNS, [&] { return event(node); }));
  };
  sample(series, {1, 2, 4, 8, 16, 32, 64, 128, 256, 512}, ROUNDS,
         [&](double at) -> std::vector<double> {
           const auto interfaces = static_cast<unsigned>(at);
           const auto spread = one(interfaces, bench::INTERFACES_OF_A_NODE);
           const auto together = one(interfaces, MOST_INTERFACES);
           return {spread.first, together.first, spread.second, together.second};
         });
  bench::unpin();
  return series;
}

/* The cluster is full; one node has all the instances but one, and another node that one. */
Series growInstances() {
  enum : uint8_t { BUSY, ELSEWHERE };
  Cluster cluster;
  bench::pin(0);
  Series series{"instances",
                "instances",
                {{"refresh, an instance", "ns"},
                 {"change, until all is done", "ns"},
                 {"change elsewhere", "ns"},
                 {"memory, an instance", "bytes"}},
                {}};
  sample(series, {1, 10, 100, 1000, 10'000, 100'000}, ROUNDS,
         [&](double at) -> std::vector<double> {
           const uint32_t before = cluster.heap().used;
           WatchedNode busy(cluster, BUSY, static_cast<size_t>(at));
           const double bytes = (cluster.heap().used - before) / at;
           WatchedNode elsewhere(cluster, ELSEWHERE, 1);
           const bench::OthersPinned pinned(0);
           std::vector<double> walks;
           const double all = medianOf(TURNS, [&] {
             const Clock::time_point start = Clock::now();
             event(busy);
             const double taken = nanoseconds(Clock::now() - start);
             walks.push_back(nanoseconds(busy.span()));
             return taken;
           });
           /* From the first callback to the last one: one alone has no such walk. */
           std::nth_element(walks.begin(), walks.begin() + TURNS / 2, walks.end());
           const double each = at > 1 ? walks[TURNS / 2] / (at - 1) : NAN;
           return {each, all, medianOf(MANY_TURNS, [&] { return event(elsewhere); }), bytes};
         });
  bench::unpin();
  return series;
}

}  // namespace growth
