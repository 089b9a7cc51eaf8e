/* The ordered map of karst_rbtree.h: no lock, no recursion, and no allocation but a tree's own
 * nodes.
 *
 * The mirror cases of the textbook are written once: a side says which child is meant, and the
 * other side is its opposite.
 *
 *        x                 y
 *       / \               / \         RbtLeftRotate(x): the right child y takes x's place
 *      a   y     <->     x   c        RbtRightRotate(y): the left child x takes y's place
 *         / \           / \
 *        b   c         a   b
 */
#include "karst/karst_rbtree.h"

#include "karst/karst_assert.h"

namespace {

enum Side { LEFT = 0, RIGHT = 1 };

Side Opposite(Side side) {
  return side == LEFT ? RIGHT : LEFT;
}

KARSTRBTreeNode *At(const KARSTRBTree *tree, uint64_t link) {
  return (KARSTRBTreeNode *)(tree->base + link);
}

uint64_t LinkTo(const KARSTRBTree *tree, const void *address) {
  return (uint64_t)address - tree->base;
}

const KARSTRBTreeKey *KeyOf(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  return (const KARSTRBTreeKey *)(tree->base + node->key);
}

KARSTRBTreeNode *Nil(const KARSTRBTree *tree) {
  return At(tree, tree->data->nil);
}
KARSTRBTreeNode *Root(const KARSTRBTree *tree) {
  return At(tree, tree->data->root);
}
KARSTRBTreeNode *Parent(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  return At(tree, node->parent);
}

KARSTRBTreeNode *Child(const KARSTRBTree *tree, const KARSTRBTreeNode *node, Side side) {
  return At(tree, side == LEFT ? node->left : node->right);
}

void SetChild(const KARSTRBTree *tree, KARSTRBTreeNode *node, Side side,
              const KARSTRBTreeNode *child) {
  (side == LEFT ? node->left : node->right) = LinkTo(tree, child);
}

void SetParent(const KARSTRBTree *tree, KARSTRBTreeNode *node, const KARSTRBTreeNode *parent) {
  node->parent = LinkTo(tree, parent);
}

bool IsRed(const KARSTRBTreeNode *node) {
  return (node->word & KARSTRBTREE_NODE_RED) != 0;
}
void SetRed(KARSTRBTreeNode *node) {
  node->word |= KARSTRBTREE_NODE_RED;
}
void SetBlack(KARSTRBTreeNode *node) {
  node->word &= ~KARSTRBTREE_NODE_RED;
}
void CopyColour(KARSTRBTreeNode *to, const KARSTRBTreeNode *from) {
  to->word = (to->word & ~KARSTRBTREE_NODE_RED) | (from->word & KARSTRBTREE_NODE_RED);
}

/* Which child of its parent the node is; the node is not the root. */
Side SideOf(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  return Child(tree, Parent(tree, node), LEFT) == node ? LEFT : RIGHT;
}

/* Lets `replacement` stand where `node` hangs: below its parent, or as the root. Leaves the
 * replacement's own links alone. */
void ReplaceBelowParent(KARSTRBTree *tree, const KARSTRBTreeNode *node,
                        const KARSTRBTreeNode *replacement) {
  KARSTRBTreeNode *parent = Parent(tree, node);
  if (parent == Nil(tree)) {
    tree->data->root = LinkTo(tree, replacement);
  } else {
    SetChild(tree, parent, SideOf(tree, node), replacement);
  }
}

/* Rotates towards `side`: the child on the other side takes the node's place. */
void Rotate(KARSTRBTree *tree, KARSTRBTreeNode *node, Side side) {
  KARSTRBTreeNode *riser = Child(tree, node, Opposite(side));
  KARSTRBTreeNode *between = Child(tree, riser, side);
  SetChild(tree, node, Opposite(side), between);
  if (between != Nil(tree)) SetParent(tree, between, node);
  ReplaceBelowParent(tree, node, riser);
  riser->parent = node->parent;
  SetChild(tree, riser, side, node);
  SetParent(tree, node, riser);
}

void RbtLeftRotate(KARSTRBTree *tree, KARSTRBTreeNode *node) {
  Rotate(tree, node, LEFT);
}
void RbtRightRotate(KARSTRBTree *tree, KARSTRBTreeNode *node) {
  Rotate(tree, node, RIGHT);
}

void RotateTowards(KARSTRBTree *tree, KARSTRBTreeNode *node, Side side) {
  if (side == LEFT) {
    RbtLeftRotate(tree, node);
  } else {
    RbtRightRotate(tree, node);
  }
}

/* The last node from `node` down along one side. */
KARSTRBTreeNode *Outermost(const KARSTRBTree *tree, KARSTRBTreeNode *node, Side side) {
  for (KARSTRBTreeNode *next = Child(tree, node, side); next != Nil(tree);
       next = Child(tree, next, side)) {
    node = next;
  }
  return node;
}

/* The neighbour in order on one side, or the nil. */
KARSTRBTreeNode *Neighbour(const KARSTRBTree *tree, const KARSTRBTreeNode *node, Side side) {
  KARSTRBTreeNode *child = Child(tree, node, side);
  if (child != Nil(tree)) return Outermost(tree, child, Opposite(side));
  KARSTRBTreeNode *ancestor = Parent(tree, node);
  while (ancestor != Nil(tree) && node == Child(tree, ancestor, side)) {
    node = ancestor;
    ancestor = Parent(tree, ancestor);
  }
  return ancestor;
}

KARSTRBTreeNode *RbtTreeSuccessor(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  return Neighbour(tree, node, RIGHT);
}

KARSTRBTreeNode *RbtTreePredecessor(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  return Neighbour(tree, node, LEFT);
}

KARSTRBTreeNode *NullIfNil(const KARSTRBTree *tree, KARSTRBTreeNode *node) {
  return node == Nil(tree) ? nullptr : node;
}

/* A red node came to hang below a red parent, perhaps: mend upwards. */
void InsertFixUp(KARSTRBTree *tree, KARSTRBTreeNode *node) {
  while (node != Root(tree) && IsRed(Parent(tree, node))) {
    KARSTRBTreeNode *parent = Parent(tree, node);
    KARSTRBTreeNode *grandparent = Parent(tree, parent); /* exists: a red parent is not the root */
    Side side = SideOf(tree, parent);
    KARSTRBTreeNode *uncle = Child(tree, grandparent, Opposite(side));
    if (IsRed(uncle)) {
      SetBlack(parent);
      SetBlack(uncle);
      SetRed(grandparent);
      node = grandparent;
      continue;
    }
    if (SideOf(tree, node) != side) { /* inner child: make it the outer one */
      node = parent;
      RotateTowards(tree, node, side);
      parent = Parent(tree, node);
    }
    SetBlack(parent);
    SetRed(grandparent);
    RotateTowards(tree, grandparent, Opposite(side));
  }
  SetBlack(Root(tree));
}

/* Every path through `node` lacks one black node: mend upwards. The node may be the nil, whose
 * parent removal has set for this. */
void RemoveFixUp(KARSTRBTree *tree, KARSTRBTreeNode *node) {
  while (node != Root(tree) && !IsRed(node)) {
    KARSTRBTreeNode *parent = Parent(tree, node);
    Side side = SideOf(tree, node);
    KARSTRBTreeNode *sibling = Child(tree, parent, Opposite(side));
    if (IsRed(sibling)) {
      SetBlack(sibling);
      SetRed(parent);
      RotateTowards(tree, parent, side);
      sibling = Child(tree, parent, Opposite(side));
    }
    KARSTRBTreeNode *nearChild = Child(tree, sibling, side);
    KARSTRBTreeNode *farChild = Child(tree, sibling, Opposite(side));
    if (!IsRed(nearChild) && !IsRed(farChild)) {
      SetRed(sibling);
      node = parent;
      continue;
    }
    if (!IsRed(farChild)) {
      SetBlack(nearChild);
      SetRed(sibling);
      RotateTowards(tree, sibling, Opposite(side));
      sibling = Child(tree, parent, Opposite(side));
      farChild = Child(tree, sibling, Opposite(side));
    }
    CopyColour(sibling, parent);
    SetBlack(parent);
    SetBlack(farChild);
    RotateTowards(tree, parent, side);
    node = Root(tree);
  }
  SetBlack(node);
}

/* The descent of both bounds: stops at an equal node, or where the probe would hang. *order tells
 * how the probe compares to the node returned. The tree is not empty. */
KARSTRBTreeNode *Descend(const KARSTRBTree *tree, const KARSTRBTreeKey *probe, int *order) {
  KARSTRBTreeNode *node = Root(tree);
  for (;;) {
    *order = KARSTRBTreeCompare(probe, KeyOf(tree, node));
    if (*order == 0) return node;
    KARSTRBTreeNode *child = Child(tree, node, *order < 0 ? LEFT : RIGHT);
    if (child == Nil(tree)) return node;
    node = child;
  }
}

bool EqualsProbe(const KARSTRBTree *tree, const KARSTRBTreeKey *probe,
                 const KARSTRBTreeNode *node) {
  return node != Nil(tree) && KARSTRBTreeCompare(probe, KeyOf(tree, node)) == 0;
}

}  // namespace

/* ---- Making and ending trees ----------------------------------------------------------------- */

uint8_t KARSTRBTree_CreateTreeData(KARSTRBTree *tree, KARSTRBTreeNode *nil) {
  tree->data = (KARSTRBTreeData *)tree->calloc(tree, 1, sizeof(KARSTRBTreeData));
  if (tree->data == nullptr) return 0;

  uint32_t nilAllocated = nil == nullptr;
  if (nilAllocated) {
    nil = (KARSTRBTreeNode *)tree->calloc(tree, 1, sizeof(KARSTRBTreeNode));
    if (nil == nullptr) {
      tree->free(tree, tree->data);
      tree->data = nullptr;
      return 0;
    }
  }
  uint64_t nilLink = LinkTo(tree, nil);
  tree->data->nilAllocated = nilAllocated;
  tree->data->count = 0;
  tree->data->root = nilLink;
  tree->data->nil = nilLink;
  nil->parent = nilLink;
  nil->left = nilLink;
  nil->right = nilLink;
  nil->word = KARSTRBTREE_NODE_ALLOCATED; /* black, value 0 */
  return 1;
}

KARSTRBTree *KARSTRBTree_AllocTreeWithNil(const KARSTMemPool *pool, KARSTRBTreeNode *nil) {
  KARSTRBTree *tree = (KARSTRBTree *)pool->calloc((void *)pool, 1, sizeof(KARSTRBTree));
  if (tree == nullptr) return nullptr;
  tree->alloc = pool->alloc;
  tree->calloc = pool->calloc;
  tree->realloc = pool->realloc;
  tree->free = pool->free;
  tree->base = pool->base;
  tree->freeValFn = nullptr;
  tree->mpFreeValFn = nullptr;
  tree->treeAllocated = 1;
  tree->data = nullptr;
  if (!KARSTRBTree_CreateTreeData(tree, nil)) {
    tree->free(tree, tree);
    return nullptr;
  }
  return tree;
}

KARSTRBTree *KARSTRBTree_AllocTreeEx(const KARSTMemPool *pool) {
  return KARSTRBTree_AllocTreeWithNil(pool, nullptr);
}

KARSTRBTree *KARSTRBTree_AllocTree(void) {
  KARST_NOT_IMPLEMENTED("karst/karst_rbtree_impl");
}

void KARSTRBTree_FreeTree(KARSTRBTree *tree) {
  if (tree == nullptr) return;
  if (tree->data != nullptr) {
    KARSTRBTree_Clear(tree);
    KARSTRBTreeNode *nil = Nil(tree);
    if (tree->data->nilAllocated && (nil->word & KARSTRBTREE_NODE_ALLOCATED)) {
      tree->free(tree, nil);
    }
    tree->free(tree, tree->data);
  }
  if (tree->treeAllocated == 1) tree->free(tree, tree);
}

KARSTRBTreeFreeValFn KARSTRBTree_SetFreeValFn(KARSTRBTree *tree, KARSTRBTreeFreeValFn function) {
  KARSTRBTreeFreeValFn previous = tree->freeValFn;
  tree->freeValFn = function;
  tree->mpFreeValFn = nullptr;
  return previous;
}

KARSTRBTreeMpFreeValFn KARSTRBTree_SetMpFreeValFn(KARSTRBTree *tree,
                                                  KARSTRBTreeMpFreeValFn function) {
  KARSTRBTreeMpFreeValFn previous = tree->mpFreeValFn;
  tree->mpFreeValFn = function;
  tree->freeValFn = nullptr;
  return previous;
}

/* ---- Insertion ------------------------------------------------------------------------------- */

KARSTRBTreeNode *PREF_InsertEx(KARSTRBTree *tree, KARSTRBTreeNode *node, KARSTRBTreeKey *key,
                               uint32_t value) {
  uint32_t allocated = node == nullptr;
  if (allocated) {
    node = (KARSTRBTreeNode *)tree->calloc(tree, 1, sizeof(KARSTRBTreeNode));
    if (node == nullptr) return nullptr;
  }
  uint64_t nilLink = tree->data->nil;
  node->word = (value & KARSTRBTREE_NODE_VALUE) | KARSTRBTREE_NODE_RED |
               (allocated ? KARSTRBTREE_NODE_ALLOCATED : 0);
  node->parent = nilLink;
  node->left = nilLink;
  node->right = nilLink;
  node->key = key == nullptr ? 0 : LinkTo(tree, key);

  if (Root(tree) == Nil(tree)) {
    tree->data->root = LinkTo(tree, node);
  } else {
    KARSTRBTreeNode *parent = Nil(tree);
    Side side = LEFT;
    for (KARSTRBTreeNode *next = Root(tree); next != Nil(tree); next = Child(tree, next, side)) {
      parent = next;
      side = KARSTRBTreeCompare(key, KeyOf(tree, next)) < 0 ? LEFT : RIGHT; /* equal: behind it */
    }
    SetParent(tree, node, parent);
    SetChild(tree, parent, side, node);
  }
  InsertFixUp(tree, node);
  tree->data->count += 1;
  return node;
}

KARSTRBTreeNode *KARSTRBTree_Insert(KARSTRBTree *tree, KARSTRBTreeKey *key, uint32_t value) {
  return PREF_InsertEx(tree, nullptr, key, value);
}

KARSTRBTreeNode *KARSTRBTree_InsertNoAlloc(KARSTRBTree *tree, KARSTRBTreeNode *node,
                                           KARSTRBTreeKey *key, uint32_t value) {
  return PREF_InsertEx(tree, node, key, value);
}

/* ---- Lookup and iteration -------------------------------------------------------------------- */

uint32_t KARSTRBTree_GetSize(const KARSTRBTree *tree) {
  return tree->data->count;
}

KARSTRBTreeNode *KARSTRBTree_Find(const KARSTRBTree *tree, const KARSTRBTreeKey *probe) {
  KARSTRBTreeNode *nil = Nil(tree);
  KARSTRBTreeNode *node = Root(tree);
  while (node != nil) {
    int order = KARSTRBTreeCompare(probe, KeyOf(tree, node));
    if (order == 0) return node;
    node = Child(tree, node, order < 0 ? LEFT : RIGHT);
  }
  return nullptr;
}

KARSTRBTreeNode *KARSTRBTree_LowerBound(const KARSTRBTree *tree, const KARSTRBTreeKey *probe) {
  if (tree->data->count == 0) return nullptr;
  int order;
  KARSTRBTreeNode *node = Descend(tree, probe, &order);
  if (order < 0) return node;
  if (order > 0) return NullIfNil(tree, RbtTreeSuccessor(tree, node));
  for (KARSTRBTreeNode *before = RbtTreePredecessor(tree, node); EqualsProbe(tree, probe, before);
       before = RbtTreePredecessor(tree, before)) {
    node = before;
  }
  return node;
}

KARSTRBTreeNode *KARSTRBTree_UpperBound(const KARSTRBTree *tree, const KARSTRBTreeKey *probe) {
  if (tree->data->count == 0) return nullptr;
  int order;
  KARSTRBTreeNode *node = Descend(tree, probe, &order);
  if (order < 0) return node;
  KARSTRBTreeNode *after = RbtTreeSuccessor(tree, node);
  while (order == 0 && EqualsProbe(tree, probe, after)) after = RbtTreeSuccessor(tree, after);
  return NullIfNil(tree, after);
}

KARSTRBTreeNode *KARSTRBTree_First(const KARSTRBTree *tree) {
  if (tree->data->count == 0) return nullptr;
  return Outermost(tree, Root(tree), LEFT);
}

KARSTRBTreeNode *KARSTRBTree_Next(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  return NullIfNil(tree, RbtTreeSuccessor(tree, node));
}

KARSTRBTreeNode *KARSTRBTree_Prev(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  if (node != nullptr) return NullIfNil(tree, RbtTreePredecessor(tree, node));
  if (tree->data->count == 0) return nullptr;
  return Outermost(tree, Root(tree), RIGHT);
}

/* ---- Removal --------------------------------------------------------------------------------- */

void KARSTRBTree_Remove(KARSTRBTree *tree, KARSTRBTreeNode *node) {
  uint64_t value = node->word & KARSTRBTREE_NODE_VALUE;
  if (tree->freeValFn != nullptr) {
    tree->freeValFn(value);
  } else if (tree->mpFreeValFn != nullptr) {
    tree->mpFreeValFn(tree, value);
  }

  /* `leaver` gives up its position: the node itself, or its successor, which has no left child and
   * then takes the node's place as a whole. */
  KARSTRBTreeNode *nil = Nil(tree);
  KARSTRBTreeNode *leaver = node;
  if (Child(tree, node, LEFT) != nil && Child(tree, node, RIGHT) != nil) {
    leaver = RbtTreeSuccessor(tree, node);
  }
  KARSTRBTreeNode *orphan = Child(tree, leaver, LEFT);
  if (orphan == nil) orphan = Child(tree, leaver, RIGHT);
  orphan->parent = leaver->parent; /* the nil's too: the fix-up climbs from it */
  ReplaceBelowParent(tree, leaver, orphan);
  if (!IsRed(leaver)) RemoveFixUp(tree, orphan);

  if (leaver != node) { /* into the node's place as the fix-up has left it */
    leaver->parent = node->parent;
    leaver->left = node->left;
    leaver->right = node->right;
    CopyColour(leaver, node);
    ReplaceBelowParent(tree, node, leaver);
    SetParent(tree, Child(tree, node, LEFT), leaver);
    SetParent(tree, Child(tree, node, RIGHT), leaver);
  }
  if (node->word & KARSTRBTREE_NODE_ALLOCATED) tree->free(tree, node);
  tree->data->count -= 1;
}

void KARSTRBTree_RemoveRange(KARSTRBTree *tree, KARSTRBTreeNode *first, KARSTRBTreeNode *last) {
  while (first != last) {
    KARSTRBTreeNode *next = KARSTRBTree_Next(tree, first);
    KARSTRBTree_Remove(tree, first);
    first = next;
  }
}

void KARSTRBTree_Clear(KARSTRBTree *tree) {
  KARSTRBTree_RemoveRange(tree, KARSTRBTree_First(tree), nullptr);
}

void KARSTRBTree_Swap(KARSTRBTree *a, KARSTRBTree *b) {
  KARSTRBTreeData kept = *a->data;
  a->data->root = b->data->root;
  a->data->nil = b->data->nil;
  a->data->count = b->data->count;
  b->data->root = kept.root;
  b->data->nil = kept.nil;
  b->data->count = kept.count;
}
