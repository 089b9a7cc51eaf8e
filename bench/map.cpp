/* The ordered map as the module has it, with nodes of the caller's and UUIDs as keys, beside
 * std::map with the same order of the same keys. */
#include <cstdlib>
#include <map>
#include <memory>
#include <random>

#include "bench/subjects.h"
#include "karst/karst_rbtree.h"

namespace bench {
namespace {

/* Long enough that no branch predictor learns it by heart. */
constexpr size_t PICKS = 16384;

struct Words {
  uint64_t first, second;
  bool operator<(const Words &other) const {
    return first != other.first ? first < other.first : second < other.second;
  }
};

Words wordsOf(const zel_UUID &uuid) {
  return {KARSTRBTreeWord(uuid.bytes), KARSTRBTreeWord(uuid.bytes + 8)};
}

struct Keys {
  explicit Keys(size_t count) : uuids(count) {
    std::mt19937_64 random(count);
    for (zel_UUID &uuid : uuids) {
      for (uint8_t &byte : uuid.bytes) byte = static_cast<uint8_t>(random());
    }
    for (size_t i = 0; i < PICKS; i++) {
      picks.push_back(random() % count);
      probes.push_back(uuids[picks.back()]);
    }
  }
  std::vector<zel_UUID> uuids;
  std::vector<size_t> picks;    /* which key is next */
  std::vector<zel_UUID> probes; /* and a copy of it, away from the map's */
};

struct Functions {
  explicit Functions(const Cluster &cluster)
      : create(cluster.inModule<decltype(KARSTRBTree_AllocTreeEx)>("KARSTRBTree_AllocTreeEx")),
        end(cluster.inModule<decltype(KARSTRBTree_FreeTree)>("KARSTRBTree_FreeTree")),
        find(cluster.inModule<decltype(KARSTRBTree_Find)>("KARSTRBTree_Find")),
        insert(cluster.inModule<decltype(KARSTRBTree_InsertNoAlloc)>("KARSTRBTree_InsertNoAlloc")),
        remove(cluster.inModule<decltype(KARSTRBTree_Remove)>("KARSTRBTree_Remove")) {}
  decltype(KARSTRBTree_AllocTreeEx) *create;
  decltype(KARSTRBTree_FreeTree) *end;
  decltype(KARSTRBTree_Find) *find;
  decltype(KARSTRBTree_InsertNoAlloc) *insert;
  decltype(KARSTRBTree_Remove) *remove;
};

class OurMap {
 public:
  OurMap(const Keys &keys, const Functions &functions)
      : elements_(keys.uuids.size()),
        functions_(functions),
        tree_(functions.create(&pool), functions.end) {
    for (size_t i = 0; i < elements_.size(); i++) {
      elements_[i].uuid = keys.uuids[i];
      elements_[i].key.kind = KARSTRBTREE_KEY_UUID;
      elements_[i].key.uuid = &elements_[i].uuid;
      functions_.insert(tree_.get(), &elements_[i].node, &elements_[i].key, 0);
    }
  }
  const KARSTRBTreeNode *find(const zel_UUID &uuid) const {
    KARSTRBTreeKey probe;
    probe.kind = KARSTRBTREE_KEY_UUID;
    probe.uuid = &uuid;
    return functions_.find(tree_.get(), &probe);
  }
  bool holds(size_t pick, const zel_UUID &uuid) const {
    return find(uuid) == &elements_[pick].node;
  }
  void takeOutAndIn(size_t pick) {
    functions_.remove(tree_.get(), &elements_[pick].node);
    functions_.insert(tree_.get(), &elements_[pick].node, &elements_[pick].key, 0);
  }

 private:
  struct Element {
    KARSTRBTreeNode node;
    KARSTRBTreeKey key;
    zel_UUID uuid;
  };
  static constexpr KARSTMemPool pool = {
      [](void *, uint64_t size) { return std::malloc(size); },
      [](void *, uint32_t count, uint32_t size) { return std::calloc(count, size); },
      [](void *, void *block, uint64_t size) { return std::realloc(block, size); },
      [](void *, void *block) { std::free(block); }, 0};

  std::vector<Element> elements_;
  const Functions functions_;
  std::unique_ptr<KARSTRBTree, void (*)(KARSTRBTree *)> tree_; /* goes before its nodes */
};

class StdMap {
 public:
  explicit StdMap(const Keys &keys) {
    for (const zel_UUID &uuid : keys.uuids) {
      places_.push_back(map_.emplace(wordsOf(uuid), places_.size()).first);
    }
  }
  std::map<Words, size_t>::const_iterator find(const zel_UUID &uuid) const {
    return map_.find(wordsOf(uuid));
  }
  bool holds(size_t pick, const zel_UUID &uuid) const {
    return find(uuid) != map_.end() && find(uuid)->second == pick;
  }
  /* By node handle: like ours, without allocating. */
  void takeOutAndIn(size_t pick) {
    places_[pick] = map_.insert(map_.extract(places_[pick])).position;
  }

 private:
  std::map<Words, size_t> map_;
  std::vector<std::map<Words, size_t>::iterator> places_;
};

template <typename Map>
bool holdsAll(const Map &map, const Keys &keys) {
  for (size_t i = 0; i < PICKS; i++) {
    if (!map.holds(keys.picks[i], keys.probes[i])) return false;
  }
  return true;
}

template <typename Map>
void find(benchmark::State &state, const Map &map, const Keys &keys) {
  if (!holdsAll(map, keys)) return state.SkipWithError("a key was not found");
  size_t next = 0;
  for (auto _ : state) benchmark::DoNotOptimize(map.find(keys.probes[next++ % PICKS]));
}

template <typename Map>
void churn(benchmark::State &state, Map &map, const Keys &keys) {
  size_t next = 0;
  for (auto _ : state) map.takeOutAndIn(keys.picks[next++ % PICKS]);
  if (!holdsAll(map, keys)) state.SkipWithError("a key was lost");
}

}  // namespace

void measureMap(const Cluster &cluster) {
  const Functions functions(cluster);
  for (const size_t count : {128, 512}) {
    const auto keys = std::make_shared<const Keys>(count);
    const auto ours = std::make_shared<OurMap>(*keys, functions);
    const auto standard = std::make_shared<StdMap>(*keys);
    const std::string size = ", n = " + std::to_string(count);
    measure({"map: find" + size}, [=](auto &state) { find(state, *ours, *keys); });
    measure({"map: find" + size, "std::map"}, [=](auto &state) { find(state, *standard, *keys); });
    const std::string churned = "map: remove and insert" + size;
    measure({churned}, [=](auto &state) { churn(state, *ours, *keys); });
    measure({churned, "std::map, node handles"},
            [=](auto &state) { churn(state, *standard, *keys); });
  }
}

}  // namespace bench
