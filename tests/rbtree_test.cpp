/* The ordered map beside a sorted model: order, equal keys, bounds, ranges, swaps and the red-black
 * invariants after every step, for every kind of key and at bases that make every link relative. */
#include "karst/karst_rbtree.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <array>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <list>
#include <map>
#include <random>
#include <set>
#include <tuple>
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

  static Pool *current;

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
Pool *Pool::current;

uint32_t valueOf(const KARSTRBTreeNode *node) {
  return node->word & KARSTRBTREE_NODE_VALUE;
}

std::vector<const KARSTRBTreeNode *> nodesOf(const KARSTRBTree *tree) {
  std::vector<const KARSTRBTreeNode *> nodes;
  for (auto *node = KARSTRBTree_First(tree); node; node = KARSTRBTree_Next(tree, node)) {
    nodes.push_back(node);
  }
  return nodes;
}

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

void check(const KARSTRBTree *tree) {
  const auto *nil = reinterpret_cast<const KARSTRBTreeNode *>(tree->base + tree->data->nil);
  EXPECT_EQ(nil->word & KARSTRBTREE_NODE_RED, 0u);
  uint32_t nodes = 0;
  blackHeight(tree, tree->data->root, tree->data->nil, &nodes);
  EXPECT_EQ(KARSTRBTree_GetSize(tree), nodes);
  const KARSTRBTreeNode *before = nullptr;
  for (const KARSTRBTreeNode *node : nodesOf(tree)) {
    EXPECT_EQ(KARSTRBTree_Prev(tree, node), before);
    before = node;
  }
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
  zel_UUID own{};
  Weights weights;

  Item(uint32_t kind, std::mt19937_64 &random, zel_UUID *elsewhere) {
    const auto word = [&] { return words[random() % std::size(words)]; };
    const auto fill = [&](uint8_t *bytes) { /* least byte first */
                                            for (int i = 0; i < 2; i++) {
                                              weights.push_back(word());
                                              for (int byte = 0; byte < 8; byte++)
                                                *bytes++ = static_cast<uint8_t>(weights.back() >>
                                                                                8 * byte);
                                            }
    };
    const uint8_t type = types[random() % std::size(types)];
    key.kind = kind;
    if (kind == KARSTRBTREE_KEY_U64) {
      weights = {key.number = word() | word()};
    } else if (kind == KARSTRBTREE_KEY_UUID) {
      key.uuid = random() % 4 ? &own : elsewhere; /* mostly, but not always, as far from the node */
      fill(const_cast<uint8_t *>(key.uuid->bytes));
    } else if (kind == KARSTRBTREE_KEY_TYPE_ID) {
      weights = {key.typeId.type = type};
      fill(key.typeId.id);
    } else {
      key.headerOffset = offsetof(Item, header) - offsetof(Item, key);
      if (kind == KARSTRBTREE_KEY_SECONDARY_HEADER) fill(header.secondaryId);
      header.type = type;
      weights.push_back(type & 0x7f);
      fill(header.id);
      weights.push_back(~(header.seq = word())); /* newest first */
    }
  }
};

struct Base {
  uint64_t address;
  bool sharesNil; /* both trees have one nil, of the caller's */
};

class Map : public ::testing::TestWithParam<std::tuple<uint32_t, Base>> {
 protected:
  /* Of equal keys the one that came first is first, as in the map. */
  using Model = std::multimap<Weights, KARSTRBTreeNode *>;

  Map() {
    for (KARSTRBTree *&tree : trees_) {
      tree = KARSTRBTree_AllocTreeWithNil(&pool_.table, base_.sharesNil ? &nil_ : nullptr);
      KARSTRBTree_SetMpFreeValFn(tree, &tell);
    }
  }
  ~Map() override {
    for (KARSTRBTree *tree : trees_) KARSTRBTree_FreeTree(tree);
  }

  static void tell(void *pool, uint64_t value) {
    told_.emplace_back(value, KARSTRBTree_GetSize(static_cast<KARSTRBTree *>(pool)));
  }

  Item &makeItem() { return items_.emplace_back(kind_, random_, &elsewhere_.emplace_back()); }

  /* Into the first tree; every other node is the tree's own. */
  void insert(uint32_t value) {
    Item &item = makeItem();
    KARSTRBTreeNode *node =
        value % 2 ? KARSTRBTree_Insert(trees_[0], &item.key, value | 0xc0000000)
                  : KARSTRBTree_InsertNoAlloc(trees_[0], &item.node, &item.key, value | 0xc0000000);
    EXPECT_EQ((node->word & KARSTRBTREE_NODE_ALLOCATED) != 0, value % 2 == 1);
    models_[0].emplace(item.weights, node);
    values_[node] = value;
  }

  /* As many as that, by one call for each or for all; each is told of first. */
  void remove(size_t count, bool range) {
    told_.clear();
    Model &model = models_[0];
    const size_t skip = random_() % (model.size() - count + 1);
    const auto first = std::next(model.begin(), static_cast<long>(skip));
    const auto last = std::next(first, static_cast<long>(count));
    std::vector<std::pair<uint64_t, uint32_t>> expected;
    std::vector<KARSTRBTreeNode *> nodes;
    for (auto it = first; it != last; ++it) {
      expected.emplace_back(values_[it->second], model.size() - expected.size());
      nodes.push_back(it->second);
    }
    if (range) {
      KARSTRBTree_RemoveRange(trees_[0], first == model.end() ? nullptr : first->second,
                              last == model.end() ? nullptr : last->second);
    } else {
      for (KARSTRBTreeNode *node : nodes) KARSTRBTree_Remove(trees_[0], node);
    }
    EXPECT_EQ(told_, expected);
    model.erase(first, last);
  }

  void swap() {
    KARSTRBTree_Swap(trees_[0], trees_[1]);
    std::swap(models_[0], models_[1]);
  }

  /* The same nodes in the same places of the order, with their own values and keys. */
  void compare() {
    for (int i : {0, 1}) {
      check(trees_[i]);
      std::vector<const KARSTRBTreeNode *> expected;
      for (const auto &[weights, node] : models_[i]) {
        expected.push_back(node);
        EXPECT_EQ(valueOf(node), values_[node]);
      }
      EXPECT_EQ(nodesOf(trees_[i]), expected);
    }
    const Item &probe = makeItem();
    const Model &model = models_[0];
    const auto node = [&](auto it) { return it == model.end() ? nullptr : it->second; };
    const auto lower = model.lower_bound(probe.weights), upper = model.upper_bound(probe.weights);
    EXPECT_EQ(KARSTRBTree_LowerBound(trees_[0], &probe.key), node(lower));
    EXPECT_EQ(KARSTRBTree_UpperBound(trees_[0], &probe.key), node(upper));
    std::set<KARSTRBTreeNode *> equal;
    for (auto it = lower; it != upper; ++it) equal.insert(it->second);
    KARSTRBTreeNode *found = KARSTRBTree_Find(trees_[0], &probe.key);
    EXPECT_EQ(equal.count(found), equal.empty() ? 0u : 1u);
    EXPECT_EQ(found == nullptr, equal.empty());
    items_.pop_back();
    elsewhere_.pop_back();
  }

  const uint32_t kind_ = std::get<0>(GetParam());
  const Base base_ = std::get<1>(GetParam());
  std::mt19937_64 random_{42};
  Pool pool_{base_.address};
  KARSTRBTreeNode nil_;
  KARSTRBTree *trees_[2];
  Model models_[2];
  std::list<Item> items_;
  std::list<zel_UUID> elsewhere_;
  std::map<const KARSTRBTreeNode *, uint32_t> values_;
  inline static std::vector<std::pair<uint64_t, uint32_t>> told_;
};

TEST_P(Map, HoldsWhatTheModelHoldsAfterEveryStep) {
  for (uint32_t step = 1; step <= 1500; step++) {
    SCOPED_TRACE(step);
    const size_t size = models_[0].size();
    const uint64_t chance = random_() % 100;
    if (chance == 0) {
      swap();
    } else if (chance == 1) {
      remove(random_() % std::min<size_t>(size + 1, 20), true);
    } else if (size == 0 || chance < (step < 1000 ? 75 : 25)) {
      insert(step);
    } else {
      remove(1, false);
    }
    compare();
    if (HasFailure()) break;
  }
  for (int i : {0, 1}) {
    KARSTRBTree_Clear(trees_[i]);
    EXPECT_THAT(nodesOf(trees_[i]), IsEmpty());
  }
}

/* The last base lies above every address: links are then negative numbers, wrapped. */
INSTANTIATE_TEST_SUITE_P(KindsAndBases, Map,
                         ::testing::Combine(::testing::Range(1u, 6u),
                                            ::testing::Values(Base{0, false}, Base{0x1000, true},
                                                              Base{0xfffffffffffff000, false})));

/* ---- Values, functions that are told, creation ----------------------------------------------- */

KARSTRBTreeKey number(uint64_t n) {
  KARSTRBTreeKey key{};
  key.kind = KARSTRBTREE_KEY_U64;
  key.number = n;
  return key;
}

struct OneTree : ::testing::Test {
  ~OneTree() override { KARSTRBTree_FreeTree(tree); }
  Pool pool{0x1000};
  KARSTRBTree *tree = KARSTRBTree_AllocTreeEx(&pool.table);
  KARSTRBTreeKey keys[2] = {number(1), number(2)};
};
using OneTreeDeathTest = OneTree;

TEST_F(OneTreeDeathTest, AnUnknownKindStopsTheSystemOnceItIsCompared) {
  KARSTRBTreeKey odd{};
  EXPECT_EQ(KARSTRBTree_Find(tree, &odd), nullptr) << "an empty tree compares nothing";
  KARSTRBTree_Insert(tree, &keys[0], 1);
  for (uint32_t kind : {0u, 6u, 7u, 0xffffffffu}) {
    odd.kind = kind;
    EXPECT_DEATH(KARSTRBTree_Find(tree, &odd),
                 "module 7: Failed at karst/karst_rbtree:[0-9]+ -- NOT REACHED");
  }
  EXPECT_DEATH(KARSTRBTree_AllocTree(), "");
}

TEST_F(OneTree, HasOneFunctionThatIsToldOfRemovals) {
  static std::vector<uint64_t> told;
  const auto plain = [](uint64_t value) { told.push_back(value); };
  const auto withPool = [](void *, uint64_t value) { told.push_back(value * 10); };
  EXPECT_EQ(KARSTRBTree_SetMpFreeValFn(tree, withPool), nullptr);
  EXPECT_EQ(KARSTRBTree_SetFreeValFn(tree, plain), nullptr) << "the previous plain one: none";
  KARSTRBTree_Remove(tree, KARSTRBTree_Insert(tree, &keys[0], 7));
  EXPECT_EQ(KARSTRBTree_SetMpFreeValFn(tree, withPool), nullptr) << "was taken out";
  KARSTRBTree_Remove(tree, KARSTRBTree_Insert(tree, &keys[0], 8));
  EXPECT_NE(KARSTRBTree_SetMpFreeValFn(tree, nullptr), nullptr);
  KARSTRBTree_Remove(tree, KARSTRBTree_Insert(tree, &keys[0], 9));
  EXPECT_THAT(told, ElementsAre(7, 80));
}

TEST_F(OneTree, TakesARemovedNodeAgainAndAnOnlyNodeWithoutAKey) {
  KARSTRBTreeNode node;
  KARSTRBTree_InsertNoAlloc(tree, &node, nullptr, 5);
  EXPECT_EQ(node.key, 0u);
  KARSTRBTree_Remove(tree, &node);
  EXPECT_EQ(valueOf(&node), 5u) << "it is not cleared";
  const KARSTRBTreeNode *other = KARSTRBTree_Insert(tree, &keys[0], 1);
  KARSTRBTree_InsertNoAlloc(tree, &node, &keys[1], 6);
  EXPECT_THAT(nodesOf(tree), ElementsAre(other, &node));
  KARSTRBTree_Remove(tree, &node);
}

TEST_F(OneTree, AndNothingElseIsThereWhenThePoolIsExhausted) {
  const size_t before = pool.out.size();
  for (int call : {1, 2, 3}) {
    pool.failAt = pool.calls + call;
    EXPECT_EQ(KARSTRBTree_AllocTreeEx(&pool.table), nullptr);
    EXPECT_EQ(pool.calls, pool.failAt);
  }
  pool.failAt = pool.calls + 1;
  EXPECT_EQ(KARSTRBTree_Insert(tree, &keys[0], 1), nullptr);
  EXPECT_THAT(nodesOf(tree), IsEmpty());
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
  EXPECT_EQ(own.data, nullptr);
  KARSTRBTree_FreeTree(&own); /* there is nothing to give back */
  EXPECT_EQ(KARSTRBTree_CreateTreeData(&own, nullptr), 1);
  auto *unmarked = reinterpret_cast<KARSTRBTreeNode *>(own.data->nil);
  unmarked->word = 0; /* somebody else's from now on */
  KARSTRBTree_FreeTree(&own);
  EXPECT_THAT(pool.out, ElementsAre(unmarked));
  pool.table.free(nullptr, unmarked);
}

}  // namespace
