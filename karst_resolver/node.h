/* Nodes of the cache: found, created, made reachable or not, marked dirty, released. All of it
 * under the cache lock, which the subscription's callback takes itself. */
#ifndef KARST_RESOLVER_NODE_H
#define KARST_RESOLVER_NODE_H

#include "karst_resolver/model.h"

extern "C" {

/* The node of a UUID, or null. Works in a disabled cache too. Time: O(log nodes). */
KARSTResolverNode *KARSTResolverFindNodeLocked(KARSTResolverCache *cache, zel_UUID uuid)
    KARST_REQUIRES(karstResolverCacheLock);

/* The same, and where there is none a new node, unreachable and with no reference: the caller takes
 * one before it gives the lock up. Null when the cache is disabled or has no free slot. */
KARSTResolverNode *KARSTResolverFindOrCreateNode(KARSTResolverCache *cache, zel_UUID uuid)
    KARST_REQUIRES(karstResolverCacheLock);

/* Reads the node's version and witness flag from its directory entry; `header` is that entry's from
 * KARST_FindEntry, or null to look it up by UUID. On a failure the node is unchanged. */
zel_Status KARSTResolverUpdateNodeVersionLocked(KARSTResolverNode *node,
                                                const KarstEntryHeader *header)
    KARST_REQUIRES(karstResolverCacheLock);

/* Makes the node reachable, which holds a reference on it, or unreachable, which may end it. */
void KARSTResolverUpdateNodeHealthLocked(KARSTResolverCache *cache, KARSTResolverNode *node,
                                         bool reachable) KARST_REQUIRES(karstResolverCacheLock);

/* Queues the node for the cache world, once, and wakes the world; nothing in a disabled cache.
 * Time: O(1). */
void KARSTResolverMarkNodeDirty(KARSTResolverCache *cache, KARSTResolverNode *node)
    KARST_REQUIRES(karstResolverCacheLock);

/* Gives one reference back; with the last one the node leaves the cache. */
void KARSTResolverReleaseNodeLocked(KARSTResolverCache *cache, KARSTResolverNode *node)
    KARST_REQUIRES(karstResolverCacheLock);

/* Callback of the subscription to all node entries; `data` is the cache. */
zel_Status KARSTResolverNodeSubCbk(void *data, const KarstEntryHeader *header, void *argument,
                                   zel_Status status) KARST_EXCLUDES(karstResolverCacheLock);

} /* extern "C" */

static inline KARSTResolverNode *KARSTResolverNodeOfTreeElem(KARSTRBTreeNode *element) {
  return element == nullptr ? nullptr
                            : KARST_RESOLVER_CONTAINER(element, KARSTResolverNode, treeElem);
}

#endif
