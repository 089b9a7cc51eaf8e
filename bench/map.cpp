/* The ordered map as the module has it, with nodes of the caller's and UUIDs as keys, beside other
 * maps of the same keys (maps.h). The limit is a chain of as many loads, each of which needs the one
 * before, as the tree is high. */
#include <algorithm>
#include <bit>
#include <numeric>
#include <random>

#include "bench/maps.h"
#include "bench/subjects.h"

namespace bench {
namespace {

const std::string OUR_SIZE = limit("boost's, our size");
const std::string CALLED = limit("boost's, our size, called");

/* Long enough that no branch predictor learns the picks by heart. */
constexpr size_t LEAST_PICKS = 16384;
/* A million would take minutes, and tell nothing that churn does not. */
constexpr size_t LARGEST_FILL = 4096;

struct Keys {
  explicit Keys(size_t count) : uuids(count) {
    std::mt19937_64 random(count);
    for (zel_UUID &uuid : uuids) {
      for (uint8_t &byte : uuid.bytes) byte = static_cast<uint8_t>(random());
    }
    for (size_t i = 0; i < std::max(LEAST_PICKS, std::bit_ceil(count)); i++) {
      picks.push_back(static_cast<uint32_t>(random() % count));
      probes.push_back(uuids[picks.back()]);
    }
  }
  size_t mask() const { return picks.size() - 1; } /* their count is a power of two */

  std::vector<zel_UUID> uuids;
  std::vector<uint32_t> picks;  /* which key is next */
  std::vector<zel_UUID> probes; /* and a copy of it, away from the map's */
};

/* As many as matter: of a million keys, some. */
template <typename Map>
bool holdsAll(const Map &map, const Keys &keys) {
  for (size_t i = 0; i < LEAST_PICKS; i++) {
    const uint32_t *const found = map.find(keys.probes[i]);
    if (found == nullptr || *found != keys.picks[i]) return false;
  }
  return true;
}

template <typename Map>
void findIndependent(benchmark::State &state, const Map &map, const Keys &keys) {
  if (!holdsAll(map, keys)) return state.SkipWithError("a key was not found");
  size_t next = 0;
  for (auto _ : state) benchmark::DoNotOptimize(map.find(keys.probes[next++ & keys.mask()]));
}

/* What is looked up next is known when the last has been found. */
template <typename Map>
void findDependent(benchmark::State &state, const Map &map, const Keys &keys) {
  size_t next = 0;
  for (auto _ : state) {
    const uint32_t found = *map.find(keys.probes[next & keys.mask()]);
    next += 1 + (found >> 31); /* numbers are small: the next one, but the processor cannot know */
  }
  benchmark::DoNotOptimize(next);
}

template <typename Map>
void churn(benchmark::State &state, Map &map, const Keys &keys) {
  size_t next = 0;
  for (auto _ : state) map.takeOutAndIn(keys.picks[next++ & keys.mask()]);
  if (!holdsAll(map, keys)) state.SkipWithError("a key was lost");
}

template <typename Map>
void fillAndDrain(benchmark::State &state, Map &map, const Keys &keys) {
  state.counters[ITEMS] = static_cast<double>(keys.uuids.size());
  for (auto _ : state) {
    map.removeAll();
    map.insertAll();
  }
  if (!holdsAll(map, keys)) state.SkipWithError("a key was lost");
}

template <typename Map>
void fill(benchmark::State &state, Map &map, const Keys &keys) {
  state.counters[ITEMS] = static_cast<double>(keys.uuids.size());
  for (auto _ : state) {
    map.removeAll();
    const Clock::time_point start = Clock::now();
    map.insertAll();
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
  }
}

template <typename Map>
void iterate(benchmark::State &state, const Map &map, const Keys &keys) {
  state.counters[ITEMS] = static_cast<double>(keys.uuids.size());
  const uint64_t all = keys.uuids.size() * (keys.uuids.size() - 1) / 2;
  for (auto _ : state) {
    if (map.iterate() != all) return state.SkipWithError("not each was met once");
  }
}

/* As many dependent loads as a perfectly balanced tree of so many keys is high, of lines that lie as
 * far apart as the tree's nodes. */
void dependentLoads(benchmark::State &state, size_t count) {
  struct alignas(64) Line {
    const Line *next;
  };
  std::vector<Line> lines(count);
  std::vector<size_t> order(count);
  std::iota(order.begin(), order.end(), size_t{0});
  std::shuffle(order.begin(), order.end(), std::mt19937_64(count));
  for (size_t i = 0; i < count; i++) lines[order[i]].next = &lines[order[(i + 1) % count]];
  const int height = std::bit_width(count);
  const Line *line = &lines[0];
  for (auto _ : state) {
    for (int i = 0; i < height; i++) line = line->next;
    benchmark::DoNotOptimize(line);
  }
}

std::string sized(const std::string &work, size_t count) {
  return work + ", n = " + std::to_string(count);
}

template <typename Map>
void measureOne(const std::string &who, size_t count, const std::shared_ptr<const Keys> &keys,
                const std::shared_ptr<Map> &map) {
  measure({sized("map: find", count), who}, [=](auto &s) { findIndependent(s, *map, *keys); });
  measure({sized("map: find, dependent", count), who},
          [=](auto &s) { findDependent(s, *map, *keys); });
  measure({sized("map: churn", count), who}, [=](auto &s) { churn(s, *map, *keys); });
  measure({sized("map: iterate", count), who}, [=](auto &s) { iterate(s, *map, *keys); });
  if (count > LARGEST_FILL) return;
  measure({sized("map: fill", count), who}, [=](auto &s) {
    fill(s, *map, *keys);
  })->UseManualTime();
  measure({sized("map: fill and drain", count), who},
          [=](auto &s) { fillAndDrain(s, *map, *keys); });
}

}  // namespace

void measureMap(const Cluster &cluster) {
  const MapFunctions functions(cluster);
  const std::vector<std::string> redBlack = {"std::map", "boost::intrusive::set", "sys/tree.h"};
  for (const size_t count : {128, 512, 4096, 1'000'000}) {
    const auto keys = std::make_shared<const Keys>(count);
    measureOne(OURS, count, keys, std::make_shared<OurMap>(keys->uuids, functions));
    measureOne("std::map", count, keys, std::make_shared<StdMap>(keys->uuids));
    measureOne("boost::intrusive::set", count, keys, std::make_shared<IntrusiveSet>(keys->uuids));
    measureOne("sys/tree.h", count, keys, std::make_shared<BsdMap>(keys->uuids));
    measureOne("absl::btree_map", count, keys, std::make_shared<BTree>(keys->uuids));
    const auto called = std::make_shared<CalledSet>(keys->uuids);
    measure({sized("map: churn", count), CALLED}, [=](auto &s) { churn(s, *called, *keys); });
    measure({sized("map: iterate", count), CALLED}, [=](auto &s) { iterate(s, *called, *keys); });
    measure({sized("map: find, dependent", count), limit("dependent loads")},
            [=](auto &s) { dependentLoads(s, count); });
    for (const char *work : {"map: churn", "map: iterate"}) nameFloor(sized(work, count), CALLED);
    if (count <= 512) {
      ask(sized("map: find", count), 0.97, redBlack);
      ask(sized("map: find", count), 0.83, {"std::map"});
      ask(sized("map: find, dependent", count), 1.03, redBlack);
      ask(sized("map: churn", count), 1.0, redBlack);
      ask(sized("map: iterate", count), 1.0, redBlack);
    } else if (count == 1'000'000) {
      measureOne(OUR_SIZE, count, keys, std::make_shared<LargerSet>(keys->uuids));
      for (const char *work : {"map: find", "map: find, dependent", "map: churn", "map: iterate"}) {
        ask(sized(work, count), 1.1, redBlack);
      }
      for (const char *work : {"map: find", "map: find, dependent"}) {
        nameFloor(sized(work, count), OUR_SIZE);
      }
    }
  }
}

}  // namespace bench
