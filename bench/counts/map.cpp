/* The ordered map of the loaded module, with UUIDs as keys: what one element takes, on average over
 * all of them. */
#include <random>

#include "bench/counts/counts.h"
#include "bench/our_map.h"

namespace bench {
namespace {

std::vector<zel_UUID> keys(size_t count) {
  std::mt19937_64 random(count);
  std::vector<zel_UUID> uuids(count);
  for (zel_UUID &uuid : uuids) {
    for (uint8_t &byte : uuid.bytes) byte = static_cast<uint8_t>(random());
  }
  return uuids;
}

}  // namespace

void countMap() {
  const Cluster cluster;
  const MapFunctions functions(cluster);
  auto *const lowerBound =
      cluster.inModule<decltype(KARSTRBTree_LowerBound)>("KARSTRBTree_LowerBound");
  auto *const clear = cluster.inModule<decltype(KARSTRBTree_Clear)>("KARSTRBTree_Clear");
  for (const size_t n : {128, 512, 4096}) {
    const std::vector<zel_UUID> uuids = keys(n);
    OurMap map(uuids, functions);
    const auto fill = [&] { map.insertAll(); };
    const auto drain = [&] { map.removeAll(); };
    count(sized("map: find", "n", n), n, [&] {
      for (const zel_UUID &uuid : uuids) map.find(uuid);
    });
    count(sized("map: lower bound", "n", n), n, [&] {
      for (const zel_UUID &uuid : uuids) {
        KARSTRBTreeKey probe;
        probe.kind = KARSTRBTREE_KEY_UUID;
        probe.uuid = &uuid;
        lowerBound(map.tree(), &probe);
      }
    });
    count(sized("map: iterate", "n", n), n, [&] { map.iterate(); });
    count(sized("map: remove", "n", n), n, drain, fill);
    count(
        sized("map: clear", "n", n), n, [&] { clear(map.tree()); }, fill);
    drain();
    count(sized("map: insert", "n", n), n, fill, drain);
  }
}

}  // namespace bench
