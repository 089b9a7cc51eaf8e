/* Changes at a growing pace, up to more than the resolver takes: the directory's queue to it
 * overflows, and what must happen then is looked at. The producer has a processor of its own, the
 * directory's threads and the resolver have the next one. */
#include <malloc.h>

#include <cstring>
#include <stdexcept>

#include "bench/bench.h"
#include "bench/growth/series.h"
#include "bench/growth/watched.h"

namespace growth {
namespace {

using bench::Clock;
using bench::Cluster;

constexpr unsigned ROUNDS = 5;
constexpr auto TIME = std::chrono::milliseconds(200); /* of changes, at each pace */
constexpr unsigned LOOK_EVERY = 64;                   /* changes */
constexpr unsigned INTERFACES = bench::NODES * bench::INTERFACES_OF_A_NODE;

/* A queue of the directory's bound, its entries and what goes with them; an unbounded one would
 * need many times as much for what is offered here. */
constexpr double MOST_MEMORY = 1 << 20; /* bytes */

double memoryInUse() {
  return static_cast<double>(mallinfo2().uordblks);
}

/* The changes: half of the nodes in turn, the first interface of each, to other addresses than
 * before. In the end every node changes once, to addresses that it has not had in this run: the
 * resolver reads what an entry says when it is told of it, so only that the other half has changed,
 * told by nothing that came before, can be missed for good. */
class Changes {
 public:
  Changes() {
    for (const uint8_t version : {1, 2}) {
      for (uint8_t node = 0; node < bench::NODES / 2; node++) {
        ordinary_.push_back(bench::interfaceEntry(node, 0, version));
      }
    }
  }
  const host::Entry &next() { return ordinary_[made_++ % ordinary_.size()]; }
  void chooseLast() {
    if (++version_ < 3) version_ = 3;
    last_.clear();
    for (uint8_t node = 0; node < bench::NODES; node++) {
      last_.push_back(bench::interfaceEntry(node, 0, version_));
    }
  }
  const host::Entry &last(size_t node) const { return last_[node]; }
  uint8_t lastVersion() const { return version_; }

 private:
  std::vector<host::Entry> ordinary_, last_;
  size_t made_ = 0;
  uint8_t version_ = 2;
};

/* What was counted while the changes came and until all had settled. */
struct Counts {
  uint64_t offered = 0, told = 0, overflows = 0, callbacks = 0, blocks = 0;
  double seconds = 0, settling = 0; /* of offering; from the last change until all is done, ns */
  double waiting = 0, memory = 0;   /* most changes that waited at once; most bytes beyond before */
};

class Load {
 public:
  explicit Load(Cluster &cluster) : cluster_(cluster), nodes_(cluster, bench::NODES) {}

  Counts offer(double pace);

  /* Each node's answer is what was put last. */
  bool rightInTheEnd() const;

 private:
  void look(const Counts &start, Counts *seen) const;
  Counts now() const;

  Cluster &cluster_;
  WatchedNodes nodes_;
  Changes changes_;
};

Counts Load::now() const {
  const host::Directory &directory = cluster_.kernel.directory();
  Counts counts;
  counts.told = directory.activity();
  counts.overflows = directory.overflows();
  counts.callbacks = nodes_.calls();
  counts.blocks = cluster_.allocations();
  counts.memory = memoryInUse();
  return counts;
}

/* The queue is full when it overflows, and cannot be told from outside afterwards. */
void Load::look(const Counts &start, Counts *seen) const {
  const host::Directory &directory = cluster_.kernel.directory();
  const auto told = static_cast<double>(directory.activity() - start.told);
  const bool overflowed = directory.overflows() != start.overflows;
  const auto bound = static_cast<double>(cluster_.kernel.settings().directory.queueBound);
  const double waiting = overflowed ? bound : static_cast<double>(seen->offered) - told;
  seen->waiting = std::max(seen->waiting, waiting);
  seen->memory = std::max(seen->memory, memoryInUse() - start.memory);
}

Counts Load::offer(double pace) {
  host::Directory &directory = cluster_.kernel.directory();
  changes_.chooseLast();
  const Counts start = now();
  Counts seen;
  const double interval = 1e9 / pace; /* 0: flat out */
  const Clock::time_point begin = Clock::now();
  double since = 0;
  for (size_t lastOnes = 0; lastOnes < bench::NODES; since = nanoseconds(Clock::now() - begin)) {
    if (static_cast<double>(seen.offered) * interval > since) continue;
    const bool ending = since >= nanoseconds(TIME);
    directory.put(ending ? changes_.last(lastOnes++) : changes_.next());
    if (++seen.offered % LOOK_EVERY == 0) look(start, &seen);
  }
  seen.seconds = since * 1e-9;
  look(start, &seen);
  cluster_.kernel.settle();
  seen.settling = nanoseconds(Clock::now() - begin) - since;
  const Counts end = now();
  seen.told = end.told - start.told;
  seen.overflows = end.overflows - start.overflows;
  seen.callbacks = end.callbacks - start.callbacks;
  seen.blocks = end.blocks - start.blocks;
  return seen;
}

bool Load::rightInTheEnd() const {
  for (uint8_t node = 0; node < bench::NODES; node++) {
    KARSTResolverNodeLocators read{};
    read.capacity = KARST_RESOLVER_MAX_LOCATORS;
    const auto &watched = nodes_.each[node];
    if (cluster_.getNodeLocators(watched->instance(), &read) != ZEL_OK) return false;
    for (uint8_t i = 0; i < KARST_RESOLVER_MAX_LOCATORS; i++) {
      const uint8_t expected[4] = {10, node, changes_.lastVersion(), i};
      if (read.count != KARST_RESOLVER_MAX_LOCATORS) return false;
      if (std::memcmp(read.locators[i].address, expected, sizeof expected) != 0) return false;
    }
  }
  return true;
}

struct Promises {
  bool overflowed = false, bounded = true, allToldUnlessOverflowed = true, resynced = true,
       right = true;

  /* A change that is told makes the resolver read one entry; an overflow call makes it read all
   * entries of interfaces. So the calls and the entries read, each a block from the heap, say how
   * many of the calls were such, whatever the directory has counted. */
  void lookAt(const Counts &seen, bool rightInTheEnd) {
    const uint64_t told = seen.told - seen.overflows;
    overflowed |= seen.overflows != 0;
    bounded &= seen.memory <= MOST_MEMORY;
    allToldUnlessOverflowed &= seen.overflows == 0 ? told == seen.offered : told < seen.offered;
    resynced &= seen.blocks == told + seen.overflows * INTERFACES;
    right &= rightInTheEnd;
  }
};

}  // namespace

Series growEvents() {
  Cluster cluster;
  Load load(cluster);
  bench::pin(0);
  const bench::OthersPinned pinned(1);
  Series series{"events",
                "changes/s",
                {{"offered", "1/s"},
                 {"delivered", "1/s"},
                 {"callbacks", "1/s"},
                 {"overflow calls", "1/s"},
                 {"most waiting", "changes"},
                 {"memory, most more", "bytes"},
                 {"settled after", "ns"}},
                {}};
  Promises promises;
  sample(series, {1e3, 3e3, 1e4, 3e4, 1e5, 2e5, 3e5, 5e5, INFINITY}, ROUNDS,
         [&](double at) -> std::vector<double> {
           const Counts seen = load.offer(at);
           promises.lookAt(seen, load.rightInTheEnd());
           const auto rate = [&](uint64_t count) {
             return static_cast<double>(count) / (seen.seconds + seen.settling * 1e-9);
           };
           return {static_cast<double>(seen.offered) / seen.seconds,
                   rate(seen.told - seen.overflows),
                   rate(seen.callbacks),
                   rate(seen.overflows),
                   seen.waiting,
                   seen.memory,
                   seen.settling};
         });
  bench::unpin();
  series.promises = {
      {"the queue has overflowed: what follows was put to the test", promises.overflowed},
      {"memory stays within 1 MiB of what it was", promises.bounded},
      {"every change is told where nothing overflowed", promises.allToldUnlessOverflowed},
      {"one call an overflow, and each makes the resolver read everything again",
       promises.resynced},
      {"every node's answer in the end is what was put last", promises.right}};
  return series;
}

}  // namespace growth
