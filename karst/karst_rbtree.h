/* An ordered map: a red-black tree with five kinds of key.
 *
 * The balancing is that of Cormen, Leiserson, Rivest and Stein, Introduction to Algorithms, chapter
 * "Red-Black Trees", with one black nil node for every missing child and for the root's parent. The
 * invariants, which tests check after every step:
 *
 *   1. a node is red or black; the root and the nil are black
 *   2. both children of a red node are black
 *   3. every path from a node down to the nil passes the same number of black nodes
 *   4. in order, keys never descend; equal keys stand in the order of their insertion
 *   5. `count` is the number of nodes that are reachable from the root
 *
 * No locking: whoever owns a tree serialises every use of it, lookups included. No recursion. No
 * allocation, except where the caller asks the tree to provide its own node. Nothing is validated.
 * Costs: a function's time is O(1) where its comment says nothing else.
 *
 * Every stored reference is a link: 0 is null, any other value v means the address base + v, where
 * base belongs to the tree's memory pool. Arguments and results are plain addresses. Nothing that a
 * tree refers to may lie at the base itself.
 */
#ifndef KARST_KARST_RBTREE_H
#define KARST_KARST_RBTREE_H

#include <stddef.h>
#include <stdint.h>

#include "platform/zel.h"

extern "C" {

/* ---- Memory ---------------------------------------------------------------------------------- */

/* Where a tree's memory comes from. The first argument of each function is the table, or a tree,
 * which begins with a copy of it. A tree calls `calloc`, always with a count of 1, and `free`. */
struct KARSTMemPool {
  void *(*alloc)(void *pool, uint64_t size);
  void *(*calloc)(void *pool, uint32_t count, uint32_t size);
  void *(*realloc)(void *pool, void *block, uint64_t size);
  void (*free)(void *pool, void *block);
  uint64_t base; /* links are relative to this address */
};

/* ---- Keys ------------------------------------------------------------------------------------ */

#define KARSTRBTREE_KEY_HEADER 1u           /* type, id, seq (descending) of a header */
#define KARSTRBTREE_KEY_SECONDARY_HEADER 2u /* secondaryId of a header, then as KEY_HEADER */
#define KARSTRBTREE_KEY_U64 3u              /* a number */
#define KARSTRBTREE_KEY_TYPE_ID 4u          /* type, then id */
#define KARSTRBTREE_KEY_UUID 5u             /* a UUID kept elsewhere */

/* A key record. It, and what it points at, stays in place and unchanged while its node is in a
 * tree; all keys of a tree are of one kind. 16-byte identifiers are compared as two little-endian
 * 64-bit words, bytes 0-7 first: byte 7 weighs most. */
struct KARSTRBTreeKey {
  uint32_t kind;
  union {
    uint32_t headerOffset; /* kinds 1, 2: the header lies this far behind the key record */
    uint64_t number;       /* kind 3 */
    struct {               /* kind 4 */
      uint8_t id[16];
      uint8_t type;
    } typeId;
    const zel_UUID *uuid; /* kind 5 */
  };
};
static_assert(offsetof(KARSTRBTreeKey, headerOffset) == 8, "layout of a key record");
static_assert(offsetof(KARSTRBTreeKey, number) == 8, "layout of a key record");
static_assert(offsetof(KARSTRBTreeKey, typeId.id) == 8, "layout of a key record");
static_assert(offsetof(KARSTRBTreeKey, typeId.type) == 24, "layout of a key record");
static_assert(offsetof(KARSTRBTreeKey, uuid) == 8, "layout of a key record");

/* What kinds 1 and 2 compare. */
struct KARSTRBTreeHeader {
  uint8_t id[16];
  uint8_t secondaryId[16];
  uint64_t seq;
  uint8_t type; /* the low 7 bits count */
};
static_assert(offsetof(KARSTRBTreeHeader, secondaryId) == 16, "layout of a header");
static_assert(offsetof(KARSTRBTreeHeader, seq) == 32, "layout of a header");
static_assert(offsetof(KARSTRBTreeHeader, type) == 40, "layout of a header");

/* ---- Nodes and trees ------------------------------------------------------------------------- */

#define KARSTRBTREE_NODE_VALUE 0x3fffffffu /* bits of KARSTRBTreeNode.word */
#define KARSTRBTREE_NODE_RED 0x40000000u
#define KARSTRBTREE_NODE_ALLOCATED 0x80000000u /* the tree allocated it and frees it on removal */

/* A node, allocated by the tree or embedded in a structure of the caller's. */
struct __attribute__((packed)) KARSTRBTreeNode {
  uint64_t parent;
  uint64_t left;
  uint64_t right;
  uint64_t key; /* link to the key record */
  uint32_t word;
};
static_assert(sizeof(KARSTRBTreeNode) == 36, "layout of a node");
static_assert(offsetof(KARSTRBTreeNode, word) == 32, "layout of a node");

struct KARSTRBTreeData {
  uint64_t root; /* equals nil when the tree is empty */
  uint64_t nil;
  uint32_t nilAllocated; /* 1: the nil came from the pool */
  uint32_t count;        /* nodes in the tree */
};
static_assert(sizeof(KARSTRBTreeData) == 24, "layout of a tree's data");

struct KARSTRBTree;
typedef void (*KARSTRBTreeFreeValFn)(uint64_t value);
typedef void (*KARSTRBTreeMpFreeValFn)(void *pool, uint64_t value);

/* Begins with the fields of the memory pool that it was created with, and so serves as that pool.
 */
struct KARSTRBTree {
  void *(*alloc)(void *pool, uint64_t size);
  void *(*calloc)(void *pool, uint32_t count, uint32_t size);
  void *(*realloc)(void *pool, void *block, uint64_t size);
  void (*free)(void *pool, void *block);
  uint64_t base;
  KARSTRBTreeFreeValFn freeValFn;     /* told the value of each node that leaves; at most one of */
  KARSTRBTreeMpFreeValFn mpFreeValFn; /* these two is set */
  uint8_t treeAllocated;              /* 1: the tree object came from the pool */
  KARSTRBTreeData *data;
};
static_assert(sizeof(KARSTRBTree) == 72, "layout of a tree");
static_assert(offsetof(KARSTRBTree, base) == offsetof(KARSTMemPool, base), "a tree is a pool");
static_assert(offsetof(KARSTRBTree, freeValFn) == 40, "layout of a tree");
static_assert(offsetof(KARSTRBTree, treeAllocated) == 56, "layout of a tree");
static_assert(offsetof(KARSTRBTree, data) == 64, "layout of a tree");

/* ---- Making and ending trees ----------------------------------------------------------------- */

/* A new empty tree with everything from `pool`, or null. With `nil`, that node of the caller's is
 * overwritten and serves as the nil; trees that share one must not be modified at the same time. */
KARSTRBTree *KARSTRBTree_AllocTreeEx(const KARSTMemPool *pool);
KARSTRBTree *KARSTRBTree_AllocTreeWithNil(const KARSTMemPool *pool, KARSTRBTreeNode *nil);

/* Gives a tree object whose other fields the caller has set up its data and nil. 1, or 0 when the
 * pool is exhausted. */
uint8_t KARSTRBTree_CreateTreeData(KARSTRBTree *tree, KARSTRBTreeNode *nil);

/* A tree without a pool: not supported, stops the system. */
KARSTRBTree *KARSTRBTree_AllocTree(void);

/* Removes every node, then gives back what the tree owns. Null is accepted. A tree object of the
 * caller's keeps a stale `data`. Time: O(count). */
void KARSTRBTree_FreeTree(KARSTRBTree *tree);

/* Install a function that removal tells the value of each node; the other kind is taken out. The
 * function runs inside the removal, before the node leaves. Result: the previous one of this kind.
 */
KARSTRBTreeFreeValFn KARSTRBTree_SetFreeValFn(KARSTRBTree *tree, KARSTRBTreeFreeValFn function);
KARSTRBTreeMpFreeValFn KARSTRBTree_SetMpFreeValFn(KARSTRBTree *tree,
                                                  KARSTRBTreeMpFreeValFn function);

/* ---- Using trees ----------------------------------------------------------------------------- */

uint32_t KARSTRBTree_GetSize(const KARSTRBTree *tree);

/* Insert behind every node with an equal key. The low 30 bits of `value` are kept. Insert allocates
 * the node and returns null, the tree unchanged, when the pool is exhausted; InsertNoAlloc cannot
 * fail; PREF_InsertEx is either, by whether `node` is null. Time: O(log count). */
KARSTRBTreeNode *KARSTRBTree_Insert(KARSTRBTree *tree, KARSTRBTreeKey *key, uint32_t value);
KARSTRBTreeNode *KARSTRBTree_InsertNoAlloc(KARSTRBTree *tree, KARSTRBTreeNode *node,
                                           KARSTRBTreeKey *key, uint32_t value);
KARSTRBTreeNode *PREF_InsertEx(KARSTRBTree *tree, KARSTRBTreeNode *node, KARSTRBTreeKey *key,
                               uint32_t value);

/* A node whose key equals the probe (with several, the one met first on the way down), or null.
 * Time: O(log count). */
KARSTRBTreeNode *KARSTRBTree_Find(const KARSTRBTree *tree, const KARSTRBTreeKey *probe);

/* The first node in order whose key is not less than, or is greater than, the probe; or null. One
 * descent and one step for each node that equals the probe: O(log count + equal nodes). */
KARSTRBTreeNode *KARSTRBTree_LowerBound(const KARSTRBTree *tree, const KARSTRBTreeKey *probe);
KARSTRBTreeNode *KARSTRBTree_UpperBound(const KARSTRBTree *tree, const KARSTRBTreeKey *probe);

/* In order; null before the first and after the last. Prev of null is the last node. Time: O(log
 * count), O(count) for a full iteration. */
KARSTRBTreeNode *KARSTRBTree_First(const KARSTRBTree *tree);
KARSTRBTreeNode *KARSTRBTree_Next(const KARSTRBTree *tree, const KARSTRBTreeNode *node);
KARSTRBTreeNode *KARSTRBTree_Prev(const KARSTRBTree *tree, const KARSTRBTreeNode *node);

/* Takes exactly this node out: no key, value or other contents move between nodes. A node of the
 * caller's is not cleared and may be inserted again at once. Time: O(log count). */
void KARSTRBTree_Remove(KARSTRBTree *tree, KARSTRBTreeNode *node);

/* Removes `first` and what follows, up to but without `last` (null: to the end). Time: O(log count)
 * for each. */
void KARSTRBTree_RemoveRange(KARSTRBTree *tree, KARSTRBTreeNode *first, KARSTRBTreeNode *last);

/* Removes every node, in ascending order. Time: O(count). */
void KARSTRBTree_Clear(KARSTRBTree *tree);

/* Exchanges root, nil and count of two trees; everything else stays with its tree. */
void KARSTRBTree_Swap(KARSTRBTree *a, KARSTRBTree *b);

} /* extern "C" */

/* ---- Key comparison -------------------------------------------------------------------------- */

static inline uint64_t KARSTRBTreeWord(const void *bytes) {
  uint64_t word;
  __builtin_memcpy(&word, bytes, sizeof word);
  return word;
}

static inline int KARSTRBTreeCompareU64(uint64_t probe, uint64_t node) {
  return probe < node ? -1 : probe > node;
}

static inline int KARSTRBTreeCompareId(const uint8_t *probe, const uint8_t *node) {
  uint64_t probeFirst = KARSTRBTreeWord(probe);
  uint64_t nodeFirst = KARSTRBTreeWord(node);
  if (probeFirst != nodeFirst) return probeFirst < nodeFirst ? -1 : 1;
  return KARSTRBTreeCompareU64(KARSTRBTreeWord(probe + 8), KARSTRBTreeWord(node + 8));
}

static inline const KARSTRBTreeHeader *KARSTRBTreeHeaderOf(const KARSTRBTreeKey *key) {
  return (const KARSTRBTreeHeader *)((const uint8_t *)key + key->headerOffset);
}

static inline int KARSTRBTreeCompareHeader(const KARSTRBTreeHeader *probe,
                                           const KARSTRBTreeHeader *node) {
  int order = KARSTRBTreeCompareU64(probe->type & 0x7f, node->type & 0x7f);
  if (order == 0) order = KARSTRBTreeCompareId(probe->id, node->id);
  if (order == 0) order = KARSTRBTreeCompareU64(node->seq, probe->seq); /* newest first */
  return order;
}

/* Negative, zero or positive as the probe sorts before, with or behind the node's key. The kind is
 * the probe's; an unknown one stops the system. */
static inline int KARSTRBTreeCompare(const KARSTRBTreeKey *probe, const KARSTRBTreeKey *node) {
  switch (probe->kind) {
    case KARSTRBTREE_KEY_UUID:
      return KARSTRBTreeCompareId(probe->uuid->bytes, node->uuid->bytes);
    case KARSTRBTREE_KEY_U64:
      return KARSTRBTreeCompareU64(probe->number, node->number);
    case KARSTRBTREE_KEY_TYPE_ID: {
      int order = KARSTRBTreeCompareU64(probe->typeId.type, node->typeId.type);
      return order != 0 ? order : KARSTRBTreeCompareId(probe->typeId.id, node->typeId.id);
    }
    case KARSTRBTREE_KEY_HEADER:
      return KARSTRBTreeCompareHeader(KARSTRBTreeHeaderOf(probe), KARSTRBTreeHeaderOf(node));
    case KARSTRBTREE_KEY_SECONDARY_HEADER: {
      const KARSTRBTreeHeader *probeHeader = KARSTRBTreeHeaderOf(probe);
      const KARSTRBTreeHeader *nodeHeader = KARSTRBTreeHeaderOf(node);
      int order = KARSTRBTreeCompareId(probeHeader->secondaryId, nodeHeader->secondaryId);
      return order != 0 ? order : KARSTRBTreeCompareHeader(probeHeader, nodeHeader);
    }
    default:
      zel_PanicWithModuleID(zel_ModuleCurrentID, "Failed at %s:%d -- NOT REACHED",
                            "karst/karst_rbtree", __LINE__);
  }
}

#endif
