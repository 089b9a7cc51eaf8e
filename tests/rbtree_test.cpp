/* The ordered map beside a sorted model: order, equal keys, bounds, ranges, swaps and the red-black
 * invariants after every step, for every kind of key and at bases that make every link relative. */
#include "karst/karst_rbtree.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <list>
#include <map>
#include <random>
#include <set>
#include <vector>

extern "C" {
zel_ModuleID zel_ModuleCurrentID = 7;
void zel_PanicWithModuleID(zel_ModuleID moduleID, const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  std::fprintf(stderr, "module %u: ", moduleID);
  std::vfprintf(stderr, format, arguments);
  va_end(arguments);
  std::abort();
}
}

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

/* A pool that knows what is out, and can be told to fail. */
struct Pool {
  KARSTMemPool table{};
  std::set<void *> out;
  int calls = 0;
  int failAt = 0; /* 0: never */

  inline static Pool *current;

  explicit Pool(uint64_t base = 0) {
    current = this;
    table.calloc = [](void *, uint32_t count, uint32_t size) -> void * {
      EXPECT_EQ(count, 1u);
      if (++current->calls == current->failAt) return nullptr;
      return *current->out.insert(std::calloc(count, size)).first;
    };
    table.free = [](void *, void *block) {
      EXPECT_EQ(current->out.erase(block), 1u) << "not a block that is out";
      std::free(block);
    };
    table.base = base;
  }
  ~Pool() { EXPECT_THAT(out, IsEmpty()) << "was not given back"; }
};

/* A node and its value. */
using Entry = std::pair<KARSTRBTreeNode *, uint32_t>;

/* The black nodes on every path below a link; recursion is the checker's privilege. */
int blackHeight(const KARSTRBTree *tree, uint64_t link, uint64_t parent, uint32_t *nodes) {
  if (link == tree->data->nil) return 0;
  const auto at = [=](uint64_t to) {
    return reinterpret_cast<const KARSTRBTreeNode *>(tree->base + to);
  };
  const auto red = [=](uint64_t to) { return (at(to)->word & KARSTRBTREE_NODE_RED) != 0; };
  ++*nodes;
  EXPECT_EQ(at(link)->parent, parent);
  EXPECT_FALSE(red(link) && (parent == tree->data->nil || red(parent))) << "red below red or nil";
  const int left = blackHeight(tree, at(link)->left, link, nodes);
  EXPECT_EQ(blackHeight(tree, at(link)->right, link, nodes), left);
  return left + !red(link);
}

/* Well-formed, and with these in this order, forth and back. */
void check(const KARSTRBTree *tree, const std::vector<Entry> &expected) {
  const auto *nil = reinterpret_cast<const KARSTRBTreeNode *>(tree->base + tree->data->nil);
  EXPECT_EQ(nil->word & KARSTRBTREE_NODE_RED, 0u);
  uint32_t nodes = 0;
  blackHeight(tree, tree->data->root, tree->data->nil, &nodes);
  EXPECT_EQ(KARSTRBTree_GetSize(tree), nodes);
  KARSTRBTreeNode *at = KARSTRBTree_First(tree), *before = nullptr;
  for (const auto &[node, value] : expected) {
    ASSERT_EQ(at, node);
    EXPECT_EQ(node->word & KARSTRBTREE_NODE_VALUE, value);
    EXPECT_EQ(KARSTRBTree_Prev(tree, node), before);
    at = KARSTRBTree_Next(tree, before = node);
  }
  EXPECT_EQ(at, nullptr);
  EXPECT_EQ(KARSTRBTree_Prev(tree, nullptr), before);
}

/* ---- Random steps beside a model ------------------------------------------------------------- */

/* Values whose order is not that of their bytes. */
constexpr uint64_t words[] = {0, 1, 2, 0x100, 0x10000, 1ull << 32, 1ull << 56, 1ull << 63};
constexpr uint8_t types[] = {0, 1, 2, 0x7f, 0x80, 0x81, 0xff};

using Weights = std::vector<uint64_t>; /* what is compared of a key, in the order that it counts */

struct Item {
  KARSTRBTreeKey key{};
  KARSTRBTreeNode node{};
  KARSTRBTreeHeader header{};
  zel_UUID uuids[4]{}; /* of which it has one: mostly the first */
  Weights weights;

  Item(uint32_t kind, std::mt19937_64 &random) {
    const auto word = [&] { return words[random() % std::size(words)]; };
    const auto fill = [&](const uint8_t *id) {
      const uint64_t halves[] = {word(), word()};
      std::memcpy(const_cast<uint8_t *>(id), halves, sizeof halves);
      weights.insert(weights.end(), std::begin(halves), std::end(halves));
    };
    const uint8_t type = types[random() % std::size(types)];
    key.kind = kind;
    if (kind == KARSTRBTREE_KEY_U64) {
      weights = {key.number = word() | word()};
    } else if (kind == KARSTRBTREE_KEY_UUID) {
      key.uuid = &uuids[random() % 4 ? 0 : random() % 4];
      fill(key.uuid->bytes);
    } else if (kind == KARSTRBTREE_KEY_TYPE_ID) {
      weights = {key.typeId.type = type};
      fill(key.typeId.id);
    } else {
      key.headerOffset = offsetof(Item, header) - offsetof(Item, key);
      if (kind == KARSTRBTREE_KEY_SECONDARY_HEADER) fill(header.secondaryId);
      weights.push_back((header.type = type) & 0x7f);
      fill(header.id);
      weights.push_back(~(header.seq = word())); /* newest first */
    }
  }
};

/* Two trees, of which the first is changed, and which may share one nil of the caller's. */
class Walk {
 public:
  Walk(uint32_t kind, uint64_t base, bool sharesNil) : kind_(kind), pool_(base) {
    for (KARSTRBTree *&tree : trees_) {
      tree = KARSTRBTree_AllocTreeWithNil(&pool_.table, sharesNil ? &nil_ : nullptr);
      KARSTRBTree_SetMpFreeValFn(tree, [](void *pool, uint64_t value) {
        told_.emplace_back(value, KARSTRBTree_GetSize(static_cast<KARSTRBTree *>(pool)));
      });
    }
  }
  ~Walk() {
    for (KARSTRBTree *tree : trees_) {
      KARSTRBTree_Clear(tree);
      check(tree, {});
      KARSTRBTree_FreeTree(tree);
    }
  }

  void step(uint32_t number) {
    const size_t size = models_[0].size();
    const uint64_t chance = random_() % 100;
    if (chance == 0) {
      KARSTRBTree_Swap(trees_[0], trees_[1]);
      std::swap(models_[0], models_[1]);
    } else if (chance == 1) {
      remove(random_() % std::min<size_t>(size + 1, 20), true);
    } else if (size == 0 || chance < (number < 1000 ? 75 : 25)) {
      insert(number);
    } else {
      remove(1, false);
    }
    for (int i : {0, 1}) {
      std::vector<Entry> expected;
      for (const auto &[weights, entry] : models_[i]) expected.push_back(entry);
      check(trees_[i], expected);
    }
    lookUp();
  }

 private:
  /* Of equal keys the one that came first is first, as in the map. */
  using Model = std::multimap<Weights, Entry>;

  /* Every other node is the tree's own. */
  void insert(uint32_t value) {
    Item &item = items_.emplace_back(kind_, random_);
    const bool own = value % 2 != 0;
    KARSTRBTreeNode *node =
        own ? KARSTRBTree_Insert(trees_[0], &item.key, value | 0xc0000000)
            : KARSTRBTree_InsertNoAlloc(trees_[0], &item.node, &item.key, value | 0xc0000000);
    EXPECT_EQ((node->word & KARSTRBTREE_NODE_ALLOCATED) != 0, own);
    models_[0].emplace(item.weights, Entry{node, value});
  }

  /* As many as that, by one call for each or for all; each is told of first. */
  void remove(size_t count, bool range) {
    told_.clear();
    Model &model = models_[0];
    const size_t skip = random_() % (model.size() - count + 1);
    const auto first = std::next(model.begin(), static_cast<long>(skip));
    const auto last = std::next(first, static_cast<long>(count));
    std::vector<Told> expected;
    for (auto it = first; it != last; ++it) {
      expected.emplace_back(it->second.second, model.size() - expected.size());
    }
    if (range) {
      KARSTRBTree_RemoveRange(trees_[0], nodeAt(first), nodeAt(last));
    } else {
      KARSTRBTree_Remove(trees_[0], nodeAt(first));
    }
    EXPECT_EQ(told_, expected);
    model.erase(first, last);
  }

  void lookUp() {
    const Item probe(kind_, random_);
    const auto [lower, upper] = models_[0].equal_range(probe.weights);
    EXPECT_EQ(KARSTRBTree_LowerBound(trees_[0], &probe.key), nodeAt(lower));
    EXPECT_EQ(KARSTRBTree_UpperBound(trees_[0], &probe.key), nodeAt(upper));
    std::set<KARSTRBTreeNode *> equal;
    for (auto it = lower; it != upper; ++it) equal.insert(it->second.first);
    if (equal.empty()) equal.insert(nullptr);
    EXPECT_EQ(equal.count(KARSTRBTree_Find(trees_[0], &probe.key)), 1u);
  }

  KARSTRBTreeNode *nodeAt(Model::const_iterator place) const {
    return place == models_[0].end() ? nullptr : place->second.first;
  }

  using Told = std::pair<uint64_t, uint32_t>; /* the value, and the tree's size at that moment */

  const uint32_t kind_;
  std::mt19937_64 random_{42};
  Pool pool_;
  KARSTRBTreeNode nil_;
  KARSTRBTree *trees_[2];
  Model models_[2];
  std::list<Item> items_;
  inline static std::vector<Told> told_;
};

/* The last base lies above every address: links are then negative numbers, wrapped. */
TEST(Map, HoldsWhatTheModelHoldsAfterEveryStep) {
  for (const uint64_t base : {uint64_t{0}, uint64_t{0x1000}, 0xfffffffffffff000}) {
    for (uint32_t kind = KARSTRBTREE_KEY_HEADER; kind <= KARSTRBTREE_KEY_UUID; kind++) {
      Walk walk(kind, base, base == 0x1000);
      for (uint32_t step = 1; step <= 1500; step++) {
        walk.step(step);
        ASSERT_FALSE(HasFailure()) << "kind " << kind << ", base " << base << ", step " << step;
      }
    }
  }
}

/* ---- Edges ----------------------------------------------------------------------------------- */

struct OneTree : ::testing::Test {
  OneTree() {
    key.kind = KARSTRBTREE_KEY_U64;
    key.number = 1;
  }
  ~OneTree() override { KARSTRBTree_FreeTree(tree); }
  Pool pool{0x1000};
  KARSTRBTree *tree = KARSTRBTree_AllocTreeEx(&pool.table);
  KARSTRBTreeKey key{};
};
using OneTreeDeathTest = OneTree;

TEST_F(OneTreeDeathTest, AnUnknownKindStopsTheSystemOnceItIsCompared) {
  KARSTRBTreeKey odd{};
  EXPECT_EQ(KARSTRBTree_Find(tree, &odd), nullptr) << "an empty tree compares nothing";
  KARSTRBTree_Insert(tree, &key, 1);
  EXPECT_DEATH(KARSTRBTree_Find(tree, &odd),
               "module 7: Failed at karst/karst_rbtree:[0-9]+ -- NOT REACHED");
  EXPECT_DEATH(KARSTRBTree_AllocTree(), "");
}

TEST_F(OneTree, TellsOneFunctionOfRemovalsAndTakesARemovedNodeAgain) {
  static std::vector<uint64_t> told;
  const auto plain = [](uint64_t value) { told.push_back(value); };
  const auto withPool = [](void *, uint64_t value) { told.push_back(value * 10); };
  KARSTRBTreeNode node;
  KARSTRBTree_InsertNoAlloc(tree, &node, nullptr, 7);
  EXPECT_EQ(node.key, 0u) << "an only node needs none";
  EXPECT_EQ(KARSTRBTree_SetMpFreeValFn(tree, withPool), nullptr);
  EXPECT_EQ(KARSTRBTree_SetFreeValFn(tree, plain), nullptr) << "the previous plain one: none";
  KARSTRBTree_Remove(tree, &node);
  EXPECT_EQ(node.word & KARSTRBTREE_NODE_VALUE, 7u) << "it is not cleared";
  EXPECT_EQ(KARSTRBTree_SetMpFreeValFn(tree, withPool), nullptr) << "was taken out";
  KARSTRBTree_Remove(tree, KARSTRBTree_InsertNoAlloc(tree, &node, &key, 8));
  EXPECT_NE(KARSTRBTree_SetMpFreeValFn(tree, nullptr), nullptr);
  KARSTRBTree_Remove(tree, KARSTRBTree_Insert(tree, &key, 9));
  EXPECT_THAT(std::exchange(told, {}), ElementsAre(7, 80));
}

TEST_F(OneTree, AndNothingElseIsThereWhenThePoolIsExhausted) {
  const size_t before = pool.out.size();
  for (int call : {1, 2, 3}) {
    pool.failAt = pool.calls + call;
    EXPECT_EQ(KARSTRBTree_AllocTreeEx(&pool.table), nullptr);
    EXPECT_EQ(pool.calls, pool.failAt);
  }
  pool.failAt = pool.calls + 1;
  EXPECT_EQ(KARSTRBTree_Insert(tree, &key, 1), nullptr);
  check(tree, {});
  EXPECT_THAT(pool.out, SizeIs(before));
}

TEST(Creation, LeavesTheCallersNilAndTheCallersTreeAlone) {
  Pool pool;
  KARSTRBTreeNode nil;
  std::memset(&nil, 0xaa, sizeof nil);
  KARSTRBTree *tree = KARSTRBTree_AllocTreeWithNil(&pool.table, &nil);
  EXPECT_EQ(nil.word, 0x80000000u);
  EXPECT_EQ(nil.parent, reinterpret_cast<uint64_t>(&nil));
  KARSTRBTree_FreeTree(tree); /* the pool would object to the nil */
  KARSTRBTree_FreeTree(nullptr);

  KARSTRBTree own{};
  own.calloc = pool.table.calloc;
  own.free = pool.table.free;
  pool.failAt = pool.calls + 2;
  EXPECT_EQ(KARSTRBTree_CreateTreeData(&own, nullptr), 0);
  KARSTRBTree_FreeTree(&own); /* there is nothing to give back */
  EXPECT_EQ(KARSTRBTree_CreateTreeData(&own, nullptr), 1);
  auto *unmarked = reinterpret_cast<KARSTRBTreeNode *>(own.data->nil);
  unmarked->word = 0; /* somebody else's from now on */
  KARSTRBTree_FreeTree(&own);
  EXPECT_THAT(pool.out, ElementsAre(unmarked));
  pool.table.free(nullptr, unmarked);
}

}  // namespace
