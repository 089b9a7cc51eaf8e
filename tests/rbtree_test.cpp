/* The ordered map against a sorted model: order, equal keys, bounds, ranges and the red-black
 * invariants after every step, at base 0 and at a base that makes every link relative. */
#include "karst/karst_rbtree.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstdarg>
#include <cstdio>
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

/* A pool that knows what is out, and can be told to fail. */
struct Pool {
  KARSTMemPool table{};
  std::set<void *> out;
  int calls = 0;
  int failAt = 0; /* 0: never */

  static Pool *current;

  explicit Pool(uint64_t base) {
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
  ~Pool() { EXPECT_TRUE(out.empty()) << out.size() << " blocks were not given back"; }
};
Pool *Pool::current;

struct Item {
  KARSTRBTreeNode node;
  KARSTRBTreeKey key;
};

uint32_t valueOf(const KARSTRBTreeNode *node) {
  return node->word & KARSTRBTREE_NODE_VALUE;
}

std::vector<uint32_t> values(const KARSTRBTree *tree) {
  std::vector<uint32_t> result;
  for (auto *node = KARSTRBTree_First(tree); node; node = KARSTRBTree_Next(tree, node)) {
    result.push_back(valueOf(node));
  }
  return result;
}

/* The five invariants of the header; recursion is the checker's privilege. */
class Checker {
 public:
  explicit Checker(const KARSTRBTree *tree) : tree_(tree) {}

  void check() {
    ASSERT_FALSE(red(at(tree_->data->nil)));
    ASSERT_FALSE(red(at(tree_->data->root)));
    uint32_t nodes = 0;
    blackHeight(tree_->data->root, tree_->data->nil, &nodes);
    ASSERT_EQ(nodes, KARSTRBTree_GetSize(tree_));
    const KARSTRBTreeNode *before = nullptr;
    uint32_t seen = 0;
    for (auto *node = KARSTRBTree_First(tree_); node; node = KARSTRBTree_Next(tree_, node)) {
      if (before) {
        ASSERT_LE(KARSTRBTreeCompare(key(before), key(node)), 0);
      }
      ASSERT_EQ(KARSTRBTree_Prev(tree_, node), before);
      before = node;
      seen++;
    }
    ASSERT_EQ(seen, nodes);
    ASSERT_EQ(KARSTRBTree_Prev(tree_, nullptr), before);
  }

 private:
  KARSTRBTreeNode *at(uint64_t link) {
    return reinterpret_cast<KARSTRBTreeNode *>(tree_->base + link);
  }
  const KARSTRBTreeKey *key(const KARSTRBTreeNode *node) {
    return reinterpret_cast<const KARSTRBTreeKey *>(tree_->base + node->key);
  }
  static bool red(const KARSTRBTreeNode *node) { return node->word & KARSTRBTREE_NODE_RED; }

  int blackHeight(uint64_t link, uint64_t parent, uint32_t *nodes) {
    if (link == tree_->data->nil) return 0;
    KARSTRBTreeNode *node = at(link);
    ++*nodes;
    EXPECT_EQ(node->parent, parent);
    if (red(node)) {
      EXPECT_FALSE(red(at(node->left)));
      EXPECT_FALSE(red(at(node->right)));
    }
    int left = blackHeight(node->left, link, nodes);
    int right = blackHeight(node->right, link, nodes);
    EXPECT_EQ(left, right);
    return left + !red(node);
  }

  const KARSTRBTree *tree_;
};

void check(const KARSTRBTree *tree) {
  Checker(tree).check();
}

/* Numbers as keys, items of the caller's. */
struct NumberTree {
  Pool pool;
  KARSTRBTree *tree;
  std::list<Item> items;

  explicit NumberTree(uint64_t base = 0) : pool(base), tree(KARSTRBTree_AllocTreeEx(&pool.table)) {}
  ~NumberTree() { KARSTRBTree_FreeTree(tree); }

  static KARSTRBTreeKey number(uint64_t n) {
    KARSTRBTreeKey key{};
    key.kind = KARSTRBTREE_KEY_U64;
    key.number = n;
    return key;
  }
  KARSTRBTreeNode *add(uint64_t n, uint32_t value) {
    Item &item = items.emplace_back();
    item.key = number(n);
    return KARSTRBTree_InsertNoAlloc(tree, &item.node, &item.key, value);
  }
  KARSTRBTreeNode *find(uint64_t n) const {
    KARSTRBTreeKey key = number(n);
    return KARSTRBTree_Find(tree, &key);
  }
};

/* ---- Random steps against a model ------------------------------------------------------------ */

class MapModel : public ::testing::TestWithParam<uint64_t> {};

TEST_P(MapModel, HoldsAfterEveryStep) {
  NumberTree t(GetParam());
  std::multimap<uint64_t, uint32_t> model; /* also keeps equal keys in order of insertion */
  std::map<uint32_t, KARSTRBTreeNode *> nodes;
  std::mt19937_64 random(42);
  auto modelValue = [&](auto it) { return it == model.end() ? -1 : static_cast<int>(it->second); };
  auto treeValue = [](KARSTRBTreeNode *n) { return n ? static_cast<int>(valueOf(n)) : -1; };

  for (uint32_t step = 1; step <= 4000; step++) {
    bool grow = step < 1500 ? random() % 4 != 0 : random() % 4 == 0;
    if (grow || model.empty()) {
      uint64_t key = random() % 300;
      nodes[step] = t.add(key, step);
      model.emplace(key, step);
    } else {
      auto victim = std::next(model.begin(), static_cast<long>(random() % model.size()));
      KARSTRBTree_Remove(t.tree, nodes[victim->second]);
      nodes.erase(victim->second);
      model.erase(victim);
    }
    ASSERT_NO_FATAL_FAILURE(check(t.tree)) << "step " << step;
    std::vector<uint32_t> expected;
    for (auto &entry : model) expected.push_back(entry.second);
    ASSERT_EQ(values(t.tree), expected) << "step " << step;

    KARSTRBTreeKey probe = NumberTree::number(random() % 302);
    ASSERT_EQ(treeValue(KARSTRBTree_LowerBound(t.tree, &probe)),
              modelValue(model.lower_bound(probe.number)));
    ASSERT_EQ(treeValue(KARSTRBTree_UpperBound(t.tree, &probe)),
              modelValue(model.upper_bound(probe.number)));
    KARSTRBTreeNode *found = KARSTRBTree_Find(t.tree, &probe);
    ASSERT_EQ(found != nullptr, model.count(probe.number) != 0);
    if (found) {
      auto [first, last] = model.equal_range(probe.number);
      ASSERT_TRUE(std::any_of(first, last, [&](auto &e) { return e.second == valueOf(found); }));
    }
  }
}

/* The second base lies above every address: links are then negative numbers, wrapped. */
INSTANTIATE_TEST_SUITE_P(Bases, MapModel, ::testing::Values(0, 0x1000, 0xfffffffffffff000));

/* ---- Keys ------------------------------------------------------------------------------------ */

int compareUUIDs(std::array<uint8_t, 16> a, std::array<uint8_t, 16> b) {
  zel_UUID left, right;
  std::copy(a.begin(), a.end(), left.bytes);
  std::copy(b.begin(), b.end(), right.bytes);
  KARSTRBTreeKey probe{}, node{};
  probe.kind = node.kind = KARSTRBTREE_KEY_UUID;
  probe.uuid = &left;
  node.uuid = &right;
  EXPECT_EQ(KARSTRBTreeCompare(&probe, &node), -KARSTRBTreeCompare(&node, &probe));
  return KARSTRBTreeCompare(&probe, &node);
}

TEST(MapKeys, UUIDsAreTwoLittleEndianWords) {
  EXPECT_LT(compareUUIDs({0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1}, {1}), 0);
  EXPECT_LT(compareUUIDs({1}, {0, 0, 0, 0, 0, 0, 0, 1}), 0);
  EXPECT_LT(compareUUIDs({0, 0, 0, 0, 0, 0, 0, 0, 9}, {0, 0, 0, 0, 0, 0, 0, 0, 0, 1}), 0);
  EXPECT_EQ(compareUUIDs({5, 6, 7}, {5, 6, 7}), 0);
}

/* A key record with its header behind it, as the directory would lay it out. */
struct HeaderKey {
  KARSTRBTreeKey key{};
  KARSTRBTreeHeader header{};
  HeaderKey(uint32_t kind, uint8_t type, uint8_t id, uint64_t seq, uint8_t secondaryId = 0) {
    key.kind = kind;
    key.headerOffset = offsetof(HeaderKey, header);
    header.type = type;
    header.id[0] = id;
    header.seq = seq;
    header.secondaryId[15] = secondaryId;
  }
};

TEST(MapKeys, HeadersOrderByTypeIdAndDescendingSeq) {
  const uint32_t k = KARSTRBTREE_KEY_HEADER;
  auto order = [](const HeaderKey &a, const HeaderKey &b) {
    return KARSTRBTreeCompare(&a.key, &b.key);
  };
  EXPECT_LT(order({k, 4, 9, 0}, {k, 5, 1, 0}), 0) << "type first";
  EXPECT_LT(order({k, 5, 1, 0}, {k, 5, 2, 9}), 0) << "then id";
  EXPECT_LT(order({k, 5, 1, 9}, {k, 5, 1, 5}), 0) << "the larger seq first";
  EXPECT_EQ(order({k, 0x85, 1, 5}, {k, 0x05, 1, 5}), 0) << "the type's top bit does not count";
  const uint32_t s = KARSTRBTREE_KEY_SECONDARY_HEADER;
  EXPECT_LT(order({s, 9, 9, 0, 1}, {s, 1, 1, 9, 2}), 0) << "secondary id first";
  EXPECT_LT(order({s, 1, 1, 9, 2}, {s, 1, 1, 5, 2}), 0) << "then as a header";
}

TEST(MapKeys, TypeIdOrdersByWholeTypeThenId) {
  KARSTRBTreeKey a{}, b{};
  a.kind = b.kind = KARSTRBTREE_KEY_TYPE_ID;
  a.typeId.type = 0x05;
  a.typeId.id[0] = 0xff;
  b.typeId.type = 0x85;
  EXPECT_LT(KARSTRBTreeCompare(&a, &b), 0);
  b.typeId.type = 0x05;
  EXPECT_GT(KARSTRBTreeCompare(&a, &b), 0);
}

TEST(MapKeysDeathTest, UnknownKindStopsTheSystemOnceItIsCompared) {
  NumberTree t;
  KARSTRBTreeKey odd{};
  EXPECT_EQ(KARSTRBTree_Find(t.tree, &odd), nullptr) << "an empty tree compares nothing";
  t.add(1, 1);
  for (uint32_t kind : {0u, 6u, 7u, 0xffffffffu}) {
    odd.kind = kind;
    EXPECT_DEATH(KARSTRBTree_Find(t.tree, &odd),
                 "module 7: Failed at karst/karst_rbtree:[0-9]+ -- NOT REACHED");
  }
  EXPECT_DEATH(KARSTRBTree_AllocTree(), "");
}

/* ---- Values, ownership, ranges --------------------------------------------------------------- */

TEST(Map, ValueKeepsThirtyBitsAndNodesSayWhoOwnsThem) {
  NumberTree t;
  KARSTRBTreeKey key = NumberTree::number(1);
  KARSTRBTreeNode *own = KARSTRBTree_Insert(t.tree, &key, 0xc0000005);
  EXPECT_EQ(valueOf(own), 5u);
  EXPECT_TRUE(own->word & KARSTRBTREE_NODE_ALLOCATED);
  KARSTRBTreeNode *callers = t.add(2, 0xffffffff);
  EXPECT_EQ(valueOf(callers), 0x3fffffffu);
  EXPECT_FALSE(callers->word & KARSTRBTREE_NODE_ALLOCATED);

  size_t blocks = t.pool.out.size();
  KARSTRBTree_Remove(t.tree, callers);
  EXPECT_EQ(t.pool.out.size(), blocks) << "the caller's node is not the pool's";
  KARSTRBTree_Remove(t.tree, own);
  EXPECT_EQ(t.pool.out.size(), blocks - 1);
  KARSTRBTree_InsertNoAlloc(t.tree, callers, &t.items.back().key, 3);
  EXPECT_THAT(values(t.tree), ElementsAre(3)) << "a removed node may be inserted again";
}

TEST(Map, RemovalRelinksTheSuccessorAndMovesNoContents) {
  NumberTree t;
  std::vector<KARSTRBTreeNode *> nodes;
  for (uint32_t n = 0; n < 7; n++) nodes.push_back(t.add(n, 100 + n));
  auto *root = reinterpret_cast<KARSTRBTreeNode *>(t.tree->data->root);
  auto *successor = KARSTRBTree_Next(t.tree, root);
  uint64_t leftOfRoot = root->left, keyOfRoot = root->key;
  uint32_t successorValue = valueOf(successor);
  KARSTRBTree_Remove(t.tree, root);
  EXPECT_EQ(t.tree->data->root, reinterpret_cast<uint64_t>(successor));
  EXPECT_EQ(successor->left, leftOfRoot);
  EXPECT_EQ(valueOf(successor), successorValue);
  EXPECT_EQ(root->key, keyOfRoot) << "the removed node is not cleared";
  check(t.tree);
}

std::vector<uint64_t> freed;
void *freedWith;

TEST(Map, RemovalTellsTheValueFirstAndInOrder) {
  NumberTree t;
  static KARSTRBTree *tree;
  tree = t.tree;
  auto plain = [](uint64_t value) {
    freed.push_back(value);
    freed.push_back(KARSTRBTree_GetSize(tree)); /* the node is still in */
  };
  auto withPool = [](void *pool, uint64_t value) {
    freedWith = pool;
    freed.push_back(value);
  };
  EXPECT_EQ(KARSTRBTree_SetMpFreeValFn(t.tree, withPool), nullptr);
  EXPECT_EQ(KARSTRBTree_SetFreeValFn(t.tree, plain), nullptr) << "the previous plain one: none";
  EXPECT_EQ(t.tree->mpFreeValFn, nullptr);
  for (uint32_t n : {3, 1, 2}) t.add(n, n * 10);
  KARSTRBTree_Clear(t.tree);
  EXPECT_THAT(freed, ElementsAre(10, 3, 20, 2, 30, 1));
  KARSTRBTree_Clear(t.tree);
  EXPECT_EQ(freed.size(), 6u) << "an empty tree has nothing to tell";

  freed.clear();
  EXPECT_NE(KARSTRBTree_SetFreeValFn(t.tree, nullptr), nullptr);
  KARSTRBTree_SetMpFreeValFn(t.tree, withPool);
  KARSTRBTree_Remove(t.tree, t.add(7, 7));
  EXPECT_THAT(freed, ElementsAre(7));
  EXPECT_EQ(freedWith, t.tree);
}

TEST(Map, RangesAreHalfOpen) {
  NumberTree t;
  for (uint32_t n = 1; n <= 5; n++) t.add(n, n);
  KARSTRBTree_RemoveRange(t.tree, t.find(3), t.find(3));
  EXPECT_EQ(KARSTRBTree_GetSize(t.tree), 5u);
  KARSTRBTree_RemoveRange(t.tree, t.find(2), t.find(4));
  EXPECT_THAT(values(t.tree), ElementsAre(1, 4, 5));
  check(t.tree);
  KARSTRBTree_RemoveRange(t.tree, KARSTRBTree_First(t.tree), nullptr);
  EXPECT_EQ(KARSTRBTree_First(t.tree), nullptr);
  t.add(9, 9);
  EXPECT_THAT(values(t.tree), ElementsAre(9)) << "an emptied tree is usable";
}

TEST(Map, SwapExchangesContentsAndLeavesASharedNilAlone) {
  Pool pool(0);
  KARSTRBTreeNode nil;
  KARSTRBTree *a = KARSTRBTree_AllocTreeWithNil(&pool.table, &nil);
  KARSTRBTree *b = KARSTRBTree_AllocTreeWithNil(&pool.table, &nil);
  std::array<KARSTRBTreeKey, 3> keys{NumberTree::number(1), NumberTree::number(2),
                                     NumberTree::number(3)};
  for (KARSTRBTreeKey &key : keys) KARSTRBTree_Insert(a, &key, static_cast<uint32_t>(key.number));
  KARSTRBTreeData *dataOfA = a->data;
  KARSTRBTree_Swap(a, b);
  EXPECT_EQ(a->data, dataOfA);
  EXPECT_EQ(KARSTRBTree_GetSize(a), 0u);
  EXPECT_EQ(KARSTRBTree_First(a), nullptr);
  EXPECT_THAT(values(b), ElementsAre(1, 2, 3));
  check(b);
  KARSTRBTree_FreeTree(a);
  KARSTRBTree_FreeTree(b);

  KARSTRBTree *c = KARSTRBTree_AllocTreeEx(&pool.table); /* each with a nil of its own */
  KARSTRBTree *d = KARSTRBTree_AllocTreeEx(&pool.table);
  KARSTRBTree_Insert(c, &keys[0], 1);
  uint64_t nilOfC = c->data->nil;
  KARSTRBTree_Swap(c, d);
  EXPECT_EQ(d->data->nil, nilOfC);
  EXPECT_THAT(values(d), ElementsAre(1));
  EXPECT_THAT(values(c), ElementsAre());
  KARSTRBTree_FreeTree(c);
  KARSTRBTree_FreeTree(d);
}

/* ---- Creation and its failures --------------------------------------------------------------- */

TEST(MapCreation, GivesBackWhatItHasWhenThePoolIsExhausted) {
  for (int failAt = 1; failAt <= 3; failAt++) {
    Pool pool(0);
    pool.failAt = failAt;
    EXPECT_EQ(KARSTRBTree_AllocTreeEx(&pool.table), nullptr);
    EXPECT_EQ(pool.calls, failAt);
  }
  NumberTree t;
  KARSTRBTreeKey key = NumberTree::number(1);
  t.pool.failAt = 4;
  EXPECT_EQ(KARSTRBTree_Insert(t.tree, &key, 1), nullptr);
  EXPECT_EQ(KARSTRBTree_GetSize(t.tree), 0u);
}

TEST(MapCreation, CallersNilAndCallersTree) {
  Pool pool(0);
  KARSTRBTreeNode nil;
  std::memset(&nil, 0xaa, sizeof nil);
  KARSTRBTree *tree = KARSTRBTree_AllocTreeWithNil(&pool.table, &nil);
  EXPECT_EQ(nil.word, 0x80000000u);
  EXPECT_EQ(nil.parent, reinterpret_cast<uint64_t>(&nil));
  EXPECT_EQ(tree->data->nilAllocated, 0u);
  KARSTRBTree_FreeTree(tree); /* the pool would object to the nil */
  KARSTRBTree_FreeTree(nullptr);

  KARSTRBTree own{};
  own.calloc = pool.table.calloc;
  own.free = pool.table.free;
  pool.failAt = pool.calls + 2;
  EXPECT_EQ(KARSTRBTree_CreateTreeData(&own, nullptr), 0);
  EXPECT_EQ(own.data, nullptr);
  EXPECT_TRUE(pool.out.empty());
  KARSTRBTree_FreeTree(&own); /* there is nothing to give back */
  pool.failAt = 0;
  EXPECT_EQ(KARSTRBTree_CreateTreeData(&own, nullptr), 1);
  EXPECT_EQ(own.data->nilAllocated, 1u);
  KARSTRBTree_FreeTree(&own); /* data and nil, not the object */
  EXPECT_TRUE(pool.out.empty());

  EXPECT_EQ(KARSTRBTree_CreateTreeData(&own, nullptr), 1);
  auto *unmarked = reinterpret_cast<KARSTRBTreeNode *>(own.data->nil);
  unmarked->word = 0; /* somebody else's from now on */
  KARSTRBTree_FreeTree(&own);
  EXPECT_THAT(pool.out, ElementsAre(unmarked));
  pool.table.free(nullptr, unmarked);
}

TEST(MapCreation, AnOnlyNodeNeedsNoKey) {
  NumberTree t;
  KARSTRBTreeNode *node = KARSTRBTree_Insert(t.tree, nullptr, 5);
  EXPECT_EQ(node->key, 0u);
  EXPECT_THAT(values(t.tree), ElementsAre(5));
  KARSTRBTree_Remove(t.tree, node);
  EXPECT_EQ(KARSTRBTree_GetSize(t.tree), 0u);
}

}  // namespace
