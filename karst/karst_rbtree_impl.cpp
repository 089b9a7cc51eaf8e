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
  return (Side)(RIGHT - side);
}

/* What of a tree stays as it is while nodes are visited and relinked: a copy in two registers, since
 * the compiler must take any store into a node for one into the tree. Nodes are named by their links
 * here. */
struct Links {
  uint64_t base;
  uint64_t nil;
};

Links LinksOf(const KARSTRBTree *tree) {
  return {tree->base, tree->data->nil};
}

KARSTRBTreeNode *At(Links links, uint64_t link) {
  return (KARSTRBTreeNode *)(links.base + link);
}

KARSTRBTreeNode *NullIfNil(Links links, uint64_t link) {
  return link == links.nil ? nullptr : At(links, link);
}

uint64_t LinkTo(Links links, const void *address) {
  return (uint64_t)address - links.base;
}

const KARSTRBTreeKey *KeyOf(Links links, uint64_t link) {
  return (const KARSTRBTreeKey *)(links.base + At(links, link)->key);
}

uint64_t Parent(Links links, uint64_t link) {
  return At(links, link)->parent;
}

void SetParent(Links links, uint64_t link, uint64_t parent) {
  At(links, link)->parent = parent;
}

/* `right` lies behind `left`: no branch chooses between them. */
uint8_t *ChildField(Links links, uint64_t link, Side side) {
  return (uint8_t *)At(links, link) + offsetof(KARSTRBTreeNode, left) + side * sizeof(uint64_t);
}

uint64_t Child(Links links, uint64_t link, Side side) {
  return KARSTRBTreeWord(ChildField(links, link, side));
}

void SetChild(Links links, uint64_t link, Side side, uint64_t child) {
  __builtin_memcpy(ChildField(links, link, side), &child, sizeof child);
}

bool IsRed(Links links, uint64_t link) {
  return (At(links, link)->word & KARSTRBTREE_NODE_RED) != 0;
}
/* By one branch: which of them is red is anybody's guess. */
bool EitherIsRed(Links links, uint64_t link, uint64_t other) {
  return ((At(links, link)->word | At(links, other)->word) & KARSTRBTREE_NODE_RED) != 0;
}
void SetRed(Links links, uint64_t link) {
  At(links, link)->word |= KARSTRBTREE_NODE_RED;
}
void SetBlack(Links links, uint64_t link) {
  At(links, link)->word &= ~KARSTRBTREE_NODE_RED;
}
void CopyColour(Links links, uint64_t to, uint64_t from) {
  uint32_t colour = At(links, from)->word & KARSTRBTREE_NODE_RED;
  At(links, to)->word = (At(links, to)->word & ~KARSTRBTREE_NODE_RED) | colour;
}

/* Which child of this parent the node is. */
Side SideOf(Links links, uint64_t parent, uint64_t link) {
  return (Side)(At(links, parent)->left != link);
}

/* Lets `replacement` stand where a node hangs: below this parent of it, or as the root. Leaves the
 * replacement's own links alone. */
void ReplaceBelow(Links links, uint64_t *root, uint64_t parent, uint64_t link,
                  uint64_t replacement) {
  if (parent == links.nil) {
    *root = replacement;
  } else {
    SetChild(links, parent, SideOf(links, parent, link), replacement);
  }
}

/* Rotates towards `side`: the child on the other side takes the node's place. */
void Rotate(Links links, uint64_t *root, uint64_t link, Side side) {
  uint64_t parent = Parent(links, link);
  uint64_t riser = Child(links, link, Opposite(side));
  uint64_t between = Child(links, riser, side);
  SetChild(links, link, Opposite(side), between);
  if (between != links.nil) SetParent(links, between, link);
  ReplaceBelow(links, root, parent, link, riser);
  SetParent(links, riser, parent);
  SetChild(links, riser, side, link);
  SetParent(links, link, riser);
}

void RbtLeftRotate(Links links, uint64_t *root, uint64_t link) {
  Rotate(links, root, link, LEFT);
}
void RbtRightRotate(Links links, uint64_t *root, uint64_t link) {
  Rotate(links, root, link, RIGHT);
}

void RotateTowards(Links links, uint64_t *root, uint64_t link, Side side) {
  if (side == LEFT) {
    RbtLeftRotate(links, root, link);
  } else {
    RbtRightRotate(links, root, link);
  }
}

/* The last node from this one, which is not the nil, down along one side. */
inline uint64_t Outermost(Links links, uint64_t link, Side side) {
  for (;;) {
    uint64_t next = Child(links, link, side);
    if (next == links.nil) return link;
    link = next;
  }
}

/* The nearest ancestor of which the node lies on the other side, or the nil. */
inline uint64_t AncestorTowards(Links links, uint64_t link, Side side) {
  uint64_t ancestor = Parent(links, link);
  while (ancestor != links.nil && link == Child(links, ancestor, side)) {
    link = ancestor;
    ancestor = Parent(links, ancestor);
  }
  return ancestor;
}

/* The neighbour in order on one side, or the nil. Compiled into its caller: a removal knows that there
 * is a child. */
__attribute__((always_inline)) inline uint64_t Neighbour(Links links, uint64_t link, Side side) {
  uint64_t child = Child(links, link, side);
  return child == links.nil ? AncestorTowards(links, link, side)
                            : Outermost(links, child, Opposite(side));
}

uint64_t RbtTreeSuccessor(Links links, uint64_t link) {
  return Neighbour(links, link, RIGHT);
}

uint64_t RbtTreePredecessor(Links links, uint64_t link) {
  return Neighbour(links, link, LEFT);
}

/* The successor as iteration wants it: its address, or null. */
inline KARSTRBTreeNode *Following(Links links, const KARSTRBTreeNode *node) {
  if (node->right != links.nil) return At(links, Outermost(links, node->right, LEFT));
  return NullIfNil(links, AncestorTowards(links, LinkTo(links, node), RIGHT));
}

/* A red node came to hang below a red parent, perhaps: mend upwards. */
void InsertFixUp(Links links, uint64_t *root, uint64_t link) {
  uint64_t parent;
  while (IsRed(links, parent = Parent(links, link))) { /* the root's is the nil, which is black */
    uint64_t grandparent = Parent(links, parent);      /* exists: a red parent is not the root */
    Side side = SideOf(links, grandparent, parent);
    uint64_t uncle = Child(links, grandparent, Opposite(side));
    if (IsRed(links, uncle)) {
      SetBlack(links, parent);
      SetBlack(links, uncle);
      SetRed(links, grandparent);
      link = grandparent;
      continue;
    }
    if (SideOf(links, parent, link) != side) { /* inner child: make it the outer one */
      RotateTowards(links, root, parent, side);
      parent = link;
    }
    SetBlack(links, parent);
    SetRed(links, grandparent);
    RotateTowards(links, root, grandparent, Opposite(side));
    break; /* the parent is black now */
  }
  SetBlack(links, *root);
}

/* Every path through the node lacks one black node: mend upwards. The node may be the nil, whose
 * parent removal has set for this. */
void RemoveFixUp(Links links, uint64_t *root, uint64_t link) {
  while (link != *root && !IsRed(links, link)) {
    uint64_t parent = Parent(links, link);
    Side side = SideOf(links, parent, link);
    uint64_t sibling = Child(links, parent, Opposite(side));
    if (IsRed(links, sibling)) {
      SetBlack(links, sibling);
      SetRed(links, parent);
      RotateTowards(links, root, parent, side);
      sibling = Child(links, parent, Opposite(side));
    }
    uint64_t nearChild = Child(links, sibling, side);
    uint64_t farChild = Child(links, sibling, Opposite(side));
    if (!EitherIsRed(links, nearChild, farChild)) {
      SetRed(links, sibling);
      link = parent;
      continue;
    }
    if (!IsRed(links, farChild)) {
      SetBlack(links, nearChild);
      SetRed(links, sibling);
      RotateTowards(links, root, sibling, Opposite(side));
      farChild = sibling;
      sibling = nearChild;
    }
    CopyColour(links, sibling, parent);
    SetBlack(links, parent);
    SetBlack(links, farChild);
    RotateTowards(links, root, parent, side);
    link = *root;
  }
  SetBlack(links, link);
}

/* ---- Descents -------------------------------------------------------------------------------- */

/* To a node's UUID leads a chain of two loads, by the key record, while in structures that embed node
 * and UUID the one lies at the same distance from the other in all of them. So that distance is guessed
 * to be the last one's, and `guessed` (distance plus base) is where the UUID is read unless the chain
 * ends elsewhere. That is checked by a branch which the processor foresees, and so it does not wait for
 * the chain before it goes on: value speculation. */
const uint8_t *NodeUuid(Links links, uint64_t link, uint64_t *guessed) {
  uint64_t uuid = (uint64_t)KeyOf(links, link)->uuid;
  uint64_t guess = *guessed + link;
  asm("" : "+r"(guess)); /* else the compiler, knowing the two equal, would read by the chain */
  if (__builtin_expect(guess != uuid, 0)) *guessed = uuid - link;
  return (const uint8_t *)(*guessed + link);
}

/* Are the first words of two UUIDs the same? Rarely, and then the second ones decide. Asked apart from
 * which is the less, or the compiler would make one branch of both, and no conditional move. */
bool RarelyEqual(uint64_t word, uint64_t other) {
  asm("" : "+r"(word));
  return __builtin_expect(word == other, 0);
}

/* The child on the side of the probe. As likely one as the other: a conditional move, not a branch,
 * chooses. */
uint64_t ChildTowards(Links links, uint64_t link, bool less) {
  uint64_t left = At(links, link)->left;
  uint64_t right = At(links, link)->right;
  return __builtin_expect_with_probability(less, 1, 0.5) ? left : right;
}

uint64_t FindUuid(Links links, uint64_t link, const zel_UUID *uuid) {
  uint64_t first = KARSTRBTreeWord(uuid->bytes);
  uint64_t second = KARSTRBTreeWord(uuid->bytes + 8);
  uint64_t guessed = links.base;
  while (link != links.nil) {
    const uint8_t *words = NodeUuid(links, link, &guessed);
    uint64_t nodeFirst = KARSTRBTreeWord(words);
    uint64_t child = ChildTowards(links, link, first < nodeFirst);
    if (RarelyEqual(nodeFirst, first)) {
      uint64_t nodeSecond = KARSTRBTreeWord(words + 8);
      if (second == nodeSecond) break;
      child = ChildTowards(links, link, second < nodeSecond);
    }
    link = child;
  }
  return link;
}

uint64_t FindAny(Links links, uint64_t link, const KARSTRBTreeKey *probe) {
  while (link != links.nil) {
    int order = KARSTRBTreeCompare(probe, KeyOf(links, link));
    if (order == 0) break;
    link = ChildTowards(links, link, order < 0);
  }
  return link;
}

/* Where a new key comes to hang, behind what it equals: its parent, and the side there. The tree is not
 * empty. */
uint64_t PlaceForUuid(Links links, uint64_t root, const zel_UUID *uuid, Side *side) {
  uint64_t first = KARSTRBTreeWord(uuid->bytes);
  uint64_t second = KARSTRBTreeWord(uuid->bytes + 8);
  uint64_t guessed = links.base;
  for (uint64_t parent = root;;) {
    const uint8_t *words = NodeUuid(links, parent, &guessed);
    uint64_t parentFirst = KARSTRBTreeWord(words);
    bool less = first < parentFirst;
    uint64_t child = ChildTowards(links, parent, less);
    if (RarelyEqual(parentFirst, first)) {
      less = second < KARSTRBTreeWord(words + 8);
      child = ChildTowards(links, parent, less);
    }
    if (child == links.nil) {
      *side = (Side)!less;
      return parent;
    }
    parent = child;
  }
}

uint64_t PlaceForAny(Links links, uint64_t root, const KARSTRBTreeKey *key, Side *side) {
  for (uint64_t parent = root;;) {
    bool less = KARSTRBTreeCompare(key, KeyOf(links, parent)) < 0;
    uint64_t child = ChildTowards(links, parent, less);
    if (child == links.nil) {
      *side = (Side)!less;
      return parent;
    }
    parent = child;
  }
}

/* The descent of both bounds: stops at an equal node, or where the probe would hang. *order tells
 * how the probe compares to the node returned. The tree is not empty. */
uint64_t Descend(Links links, uint64_t link, const KARSTRBTreeKey *probe, int *order) {
  for (;;) {
    *order = KARSTRBTreeCompare(probe, KeyOf(links, link));
    if (*order == 0) return link;
    uint64_t child = ChildTowards(links, link, *order < 0);
    if (child == links.nil) return link;
    link = child;
  }
}

bool EqualsProbe(Links links, const KARSTRBTreeKey *probe, uint64_t link) {
  return link != links.nil && KARSTRBTreeCompare(probe, KeyOf(links, link)) == 0;
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
  uint64_t nilLink = (uint64_t)nil - tree->base;
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
    Links links = LinksOf(tree);
    KARSTRBTreeNode *nil = At(links, links.nil);
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
  Links links = LinksOf(tree);
  uint64_t link = LinkTo(links, node);
  node->word = (value & KARSTRBTREE_NODE_VALUE) | KARSTRBTREE_NODE_RED |
               (allocated ? KARSTRBTREE_NODE_ALLOCATED : 0);
  node->left = links.nil;
  node->right = links.nil;
  node->key = key == nullptr ? 0 : LinkTo(links, key);

  Side side = LEFT;
  uint64_t *root = &tree->data->root;
  if (*root == links.nil) {
    node->parent = links.nil;
    *root = link;
  } else {
    /* NOLINTNEXTLINE(clang-analyzer-core.NullDereference): the tree's second node has a key */
    node->parent = key->kind == KARSTRBTREE_KEY_UUID ? PlaceForUuid(links, *root, key->uuid, &side)
                                                     : PlaceForAny(links, *root, key, &side);
    SetChild(links, node->parent, side, link);
  }
  InsertFixUp(links, root, link);
  tree->data->count += 1;
  return node;
}

KARSTRBTreeNode *KARSTRBTree_Insert(KARSTRBTree *tree, KARSTRBTreeKey *key, uint32_t value) {
  return PREF_InsertEx(tree, nullptr, key, value);
}

/* The same function by another name: a caller that gives a node has no call more. */
__attribute__((alias("PREF_InsertEx"))) KARSTRBTreeNode *KARSTRBTree_InsertNoAlloc(
    KARSTRBTree *tree, KARSTRBTreeNode *node, KARSTRBTreeKey *key, uint32_t value);

/* ---- Lookup and iteration -------------------------------------------------------------------- */

uint32_t KARSTRBTree_GetSize(const KARSTRBTree *tree) {
  return tree->data->count;
}

KARSTRBTreeNode *KARSTRBTree_Find(const KARSTRBTree *tree, const KARSTRBTreeKey *probe) {
  Links links = LinksOf(tree);
  uint64_t root = tree->data->root;
  if (root == links.nil) return nullptr; /* whatever the probe is */
  return NullIfNil(links, probe->kind == KARSTRBTREE_KEY_UUID ? FindUuid(links, root, probe->uuid)
                                                              : FindAny(links, root, probe));
}

KARSTRBTreeNode *KARSTRBTree_LowerBound(const KARSTRBTree *tree, const KARSTRBTreeKey *probe) {
  if (tree->data->count == 0) return nullptr;
  Links links = LinksOf(tree);
  int order;
  uint64_t link = Descend(links, tree->data->root, probe, &order);
  if (order > 0) return NullIfNil(links, RbtTreeSuccessor(links, link));
  if (order < 0) return At(links, link);
  for (uint64_t before = RbtTreePredecessor(links, link); EqualsProbe(links, probe, before);
       before = RbtTreePredecessor(links, before)) {
    link = before;
  }
  return At(links, link);
}

KARSTRBTreeNode *KARSTRBTree_UpperBound(const KARSTRBTree *tree, const KARSTRBTreeKey *probe) {
  if (tree->data->count == 0) return nullptr;
  Links links = LinksOf(tree);
  int order;
  uint64_t link = Descend(links, tree->data->root, probe, &order);
  if (order < 0) return At(links, link);
  uint64_t after = RbtTreeSuccessor(links, link);
  while (order == 0 && EqualsProbe(links, probe, after)) after = RbtTreeSuccessor(links, after);
  return NullIfNil(links, after);
}

KARSTRBTreeNode *KARSTRBTree_First(const KARSTRBTree *tree) {
  if (tree->data->count == 0) return nullptr;
  Links links = LinksOf(tree);
  return At(links, Outermost(links, tree->data->root, LEFT));
}

KARSTRBTreeNode *KARSTRBTree_Next(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  /* With links that are addresses, as the module's are, no step waits for an addition. */
  if (tree->base == 0) return Following({0, tree->data->nil}, node);
  return Following(LinksOf(tree), node);
}

KARSTRBTreeNode *KARSTRBTree_Prev(const KARSTRBTree *tree, const KARSTRBTreeNode *node) {
  Links links = LinksOf(tree);
  if (node != nullptr) return NullIfNil(links, RbtTreePredecessor(links, LinkTo(links, node)));
  if (tree->data->count == 0) return nullptr;
  return At(links, Outermost(links, tree->data->root, RIGHT));
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
   * then takes the node's place as a whole. `orphan` is its only possible child. */
  Links links = LinksOf(tree);
  uint64_t *root = &tree->data->root;
  uint64_t link = LinkTo(links, node);
  uint64_t leaver = link;
  if (node->left != links.nil && node->right != links.nil) {
    leaver = RbtTreeSuccessor(links, link);
  }
  uint64_t left = Child(links, leaver, LEFT);
  uint64_t right = Child(links, leaver, RIGHT);
  uint64_t orphan = __builtin_expect_with_probability(left == links.nil, 1, 0.5) ? right : left;
  uint64_t parent = Parent(links, leaver);
  SetParent(links, orphan, parent); /* the nil's too: the fix-up climbs from it */
  ReplaceBelow(links, root, parent, leaver, orphan);
  if (EitherIsRed(links, leaver, orphan)) { /* a red leaver's orphan is black already */
    SetBlack(links, orphan);
  } else {
    RemoveFixUp(links, root, orphan);
  }

  if (leaver != link) { /* into the node's place as the fix-up has left it */
    KARSTRBTreeNode *successor = At(links, leaver);
    successor->parent = node->parent;
    successor->left = node->left;
    successor->right = node->right;
    CopyColour(links, leaver, link);
    ReplaceBelow(links, root, node->parent, link, leaver);
    SetParent(links, node->left, leaver);
    SetParent(links, node->right, leaver);
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
