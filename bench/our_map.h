/* The ordered map as the loaded module has it, with nodes of the caller's and UUIDs as keys. */
#pragma once

#include <cstdlib>
#include <memory>
#include <vector>

#include "bench/cluster.h"
#include "karst/karst_rbtree.h"

namespace bench {

/* The functions of the map, as the loaded module has them. */
struct MapFunctions {
  explicit MapFunctions(const Cluster &cluster)
      : create(cluster.inModule<decltype(KARSTRBTree_AllocTreeEx)>("KARSTRBTree_AllocTreeEx")),
        end(cluster.inModule<decltype(KARSTRBTree_FreeTree)>("KARSTRBTree_FreeTree")),
        find(cluster.inModule<decltype(KARSTRBTree_Find)>("KARSTRBTree_Find")),
        insert(cluster.inModule<decltype(KARSTRBTree_InsertNoAlloc)>("KARSTRBTree_InsertNoAlloc")),
        remove(cluster.inModule<decltype(KARSTRBTree_Remove)>("KARSTRBTree_Remove")),
        first(cluster.inModule<decltype(KARSTRBTree_First)>("KARSTRBTree_First")),
        next(cluster.inModule<decltype(KARSTRBTree_Next)>("KARSTRBTree_Next")) {}
  decltype(KARSTRBTree_AllocTreeEx) *create;
  decltype(KARSTRBTree_FreeTree) *end;
  decltype(KARSTRBTree_Find) *find;
  decltype(KARSTRBTree_InsertNoAlloc) *insert;
  decltype(KARSTRBTree_Remove) *remove;
  decltype(KARSTRBTree_First) *first;
  decltype(KARSTRBTree_Next) *next;
};

/* Ours: node, key record and UUID in one element, as the module's cache has them. */
class OurMap {
 public:
  OurMap(const std::vector<zel_UUID> &keys, const MapFunctions &functions)
      : elements_(keys.size()),
        functions_(functions),
        tree_(functions.create(&pool), functions.end) {
    for (size_t i = 0; i < keys.size(); i++) {
      elements_[i].uuid = keys[i];
      elements_[i].key.kind = KARSTRBTREE_KEY_UUID;
      elements_[i].key.uuid = &elements_[i].uuid;
      elements_[i].number = static_cast<uint32_t>(i);
    }
    insertAll();
  }
  const uint32_t *find(const zel_UUID &uuid) const {
    KARSTRBTreeKey probe;
    probe.kind = KARSTRBTREE_KEY_UUID;
    probe.uuid = &uuid;
    const KARSTRBTreeNode *const node = functions_.find(tree_.get(), &probe);
    return node == nullptr ? nullptr : &elementOf(node).number;
  }
  uint64_t iterate() const {
    uint64_t sum = 0;
    for (const KARSTRBTreeNode *node = functions_.first(tree_.get()); node != nullptr;
         node = functions_.next(tree_.get(), node)) {
      sum += elementOf(node).number;
    }
    return sum;
  }
  void insertAll() {
    for (Element &element : elements_) insert(element);
  }
  void removeAll() {
    for (Element &element : elements_) functions_.remove(tree_.get(), &element.node);
  }
  KARSTRBTree *tree() const { return tree_.get(); }
  void takeOutAndIn(size_t number) {
    functions_.remove(tree_.get(), &elements_[number].node);
    insert(elements_[number]);
  }

 private:
  /* As much of a key record as one with a UUID takes. */
  struct UuidKey {
    uint32_t kind;
    const zel_UUID *uuid;
  };
  static_assert(offsetof(UuidKey, uuid) == offsetof(KARSTRBTreeKey, uuid));
  struct Element {
    UuidKey key;
    zel_UUID uuid;
    KARSTRBTreeNode node;
    uint32_t number;
  };
  static const Element &elementOf(const KARSTRBTreeNode *node) {
    return *reinterpret_cast<const Element *>(reinterpret_cast<const char *>(node) -
                                              offsetof(Element, node));
  }
  void insert(Element &element) {
    functions_.insert(tree_.get(), &element.node, reinterpret_cast<KARSTRBTreeKey *>(&element.key),
                      0);
  }
  static constexpr KARSTMemPool pool = {
      [](void *, uint64_t size) { return std::malloc(size); },
      [](void *, uint32_t count, uint32_t size) { return std::calloc(count, size); },
      [](void *, void *block, uint64_t size) { return std::realloc(block, size); },
      [](void *, void *block) { std::free(block); }, 0};

  std::vector<Element> elements_;
  const MapFunctions functions_;
  std::unique_ptr<KARSTRBTree, void (*)(KARSTRBTree *)> tree_; /* goes before its nodes */

 public:
  static constexpr size_t elementSize = sizeof(Element);
};

}  // namespace bench
