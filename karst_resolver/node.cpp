/* Node tracking; see node.h. Under the cache lock. */
#include "karst_resolver/node.h"

#include "karst_resolver/log.h"
#include "karst_resolver/records.h"
#include "karst_resolver/trace.h"

extern "C" {

/* ---- Finding and creating -------------------------------------------------------------------- */

KARSTResolverNode *KARSTResolverFindNodeLocked(KARSTResolverCache *cache, zel_UUID uuid) {
  KARSTRBTreeKey key = {};
  key.kind = KARSTRBTREE_KEY_UUID;
  key.uuid = &uuid;
  return KARSTResolverNodeOfTreeElem(KARSTRBTree_Find(cache->nodeTree, &key));
}

KARSTResolverNode *KARSTResolverFindOrCreateNode(KARSTResolverCache *cache, zel_UUID uuid) {
  if (!cache->enabled) return nullptr;
  KARSTResolverNode *node = KARSTResolverFindNodeLocked(cache, uuid);
  if (node != nullptr) return node;
  if (KARSTResolverListIsEmpty(&cache->freeNodes)) return nullptr;

  node = KARST_RESOLVER_CONTAINER(KARSTResolverListPopFront(&cache->freeNodes), KARSTResolverNode,
                                  freeLinks);
  __builtin_memset((void *)node, 0, sizeof *node);
  KARSTResolverTagInUse(node->tag, KARST_RESOLVER_TAG_NODE);
  node->uuid = uuid;
  node->isSelf = KARSTResolverUUIDEqual(&uuid, &cache->selfUUID);
  node->key.kind = KARSTRBTREE_KEY_UUID;
  node->key.uuid = &node->uuid;
  node->locators.capacity = KARST_RESOLVER_MAX_LOCATORS;
  KARSTResolverListInit(&node->netIfList);
  KARSTResolverListInit(&node->instanceList);
  KARSTRBTree_InsertNoAlloc(cache->nodeTree, &node->treeElem, &node->key, 0);
  KARST_RESOLVER_TRACE(AddNodeToCache, 454, KARST_RESOLVER_TRACE_POINTER(node),
                       KARST_RESOLVER_TRACE_UUID(&node->uuid),
                       KARST_RESOLVER_TRACE_FLAG(node->isSelf));
  return node;
}

/* ---- Version --------------------------------------------------------------------------------- */

static zel_Status KARSTResolverFindNodeEntry(KARSTResolverNode *node,
                                             const KarstEntryHeader *header, KarstFullEntry **entry)
    KARST_REQUIRES(karstResolverCacheLock) {
  if (header != nullptr) {
    return KARST_FindFullEntryByHeader(header, 0, &resolverMshAlloc, 1, entry);
  }
  KarstQuery query = {};
  KARSTResolverFillQuery(&query, KARST_TYPE_NODE, KARST_RESOLVER_QUERY_VERSION, &node->uuid);
  return KARST_FindFullEntryByQuery(&query, 0, &resolverMshAlloc, entry);
}

zel_Status KARSTResolverUpdateNodeVersionLocked(KARSTResolverNode *node,
                                                const KarstEntryHeader *header) {
  KarstFullEntry *entry = nullptr;
  zel_Status status = KARSTResolverFindNodeEntry(node, header, &entry);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to find node entry " KARST_RESOLVER_UUID_FORMAT ": %s\n",
                          KARST_RESOLVER_UUID_BYTES(node->uuid), zel_StatusToString(status));
    return status;
  }
  KarstNodeEntry record;
  status =
      KARSTResolverDecodeEntry(entry, KarstNodeEntryTbl, "KarstNodeEntry", &record, sizeof record);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to unmarshal node entry " KARST_RESOLVER_UUID_FORMAT ": %s\n",
                          KARST_RESOLVER_UUID_BYTES(node->uuid), zel_StatusToString(status));
    return status;
  }
  node->majorVersion = record.majorVersionNum;
  node->minorVersion = record.minorVersionNum;
  node->isWitness = (record.flags & KARST_NODE_FLAG_WITNESS) != 0;
  node->locators.nodeUUID = node->uuid;
  node->locators.majorVersion = node->majorVersion;
  node->locators.minorVersion = node->minorVersion;
  return ZEL_OK;
}

/* ---- Reachability, dirt, release ------------------------------------------------------------- */

void KARSTResolverMarkNodeDirty(KARSTResolverCache *cache, KARSTResolverNode *node) {
  if (!cache->enabled) return; /* the world goes away, or is gone */
  if (!KARSTResolverLinkIsOnList(&node->dirtyLinks)) {
    KARSTResolverListAppend(&cache->dirtyNodes, &node->dirtyLinks);
  }
  /* Queued before the wake-up, and the world looks at the queue under the same lock before it
   * waits: no wake-up is lost. A world that is being created looks at the queue first thing. */
  zel_WorldForceWakeup(__atomic_load_n(&cache->world, __ATOMIC_ACQUIRE));
}

void KARSTResolverReleaseNodeLocked(KARSTResolverCache *cache, KARSTResolverNode *node) {
  KARST_RESOLVER_CHECK(node->refCount != 0);
  if (--node->refCount != 0) return;
  KARST_RESOLVER_TRACE(RemoveNodeFromCache, 453, KARST_RESOLVER_TRACE_POINTER(node),
                       KARST_RESOLVER_TRACE_UUID(&node->uuid));
  if (KARSTResolverLinkIsOnList(&node->dirtyLinks)) KARSTResolverListUnlink(&node->dirtyLinks);
  KARSTRBTree_Remove(cache->nodeTree, &node->treeElem);
  __builtin_memset((void *)node, 0, sizeof *node);
  KARSTResolverTagFree(node->tag, KARST_RESOLVER_TAG_NODE);
  KARSTResolverListPushFront(&cache->freeNodes, &node->freeLinks);
}

void KARSTResolverUpdateNodeHealthLocked(KARSTResolverCache *cache, KARSTResolverNode *node,
                                         bool reachable) {
  if ((node->reachable != 0) == reachable) return;
  node->reachable = reachable;
  KARST_RESOLVER_TRACE(UpdateNodeReachability, 50, KARST_RESOLVER_TRACE_POINTER(node),
                       KARST_RESOLVER_TRACE_UUID(&node->uuid),
                       KARST_RESOLVER_TRACE_FLAG(node->reachable), node->locators.count);
  KARSTResolverMarkNodeDirty(cache, node);
  if (reachable) {
    node->refCount++;
  } else {
    KARSTResolverReleaseNodeLocked(cache, node);
  }
}

/* ---- The subscription to all node entries ---------------------------------------------------- */

/* An entry exists: reachable, unless it cannot be read. */
static void KARSTResolverNodeEntryFound(KARSTResolverCache *cache, KARSTResolverNode *node,
                                        const KarstEntryHeader *header)
    KARST_REQUIRES(karstResolverCacheLock) {
  KARSTResolverUpdateNodeHealthLocked(cache, node, true);
  if (KARSTResolverUpdateNodeVersionLocked(node, header) != ZEL_OK) {
    KARSTResolverUpdateNodeHealthLocked(cache, node, false);
  }
}

/* Changes were lost: afterwards exactly those nodes are reachable whose entries are there and can
 * be read. Time: O(entries * log nodes). */
static void KARSTResolverRescanNodes(KARSTResolverCache *cache)
    KARST_EXCLUDES(karstResolverCacheLock) {
  KARST_RESOLVER_TRACE(RescanNodes, 230, 0);
  KARSTResolverLockCache(cache);
  KarstQuery query =
      cache->nodeSub; /* the walk is the copy's; the installed query stays untouched */
  KarstEntryHeader header;
  for (zel_Status status = KARST_FindEntry(&query, 0, &header, sizeof header); status == ZEL_OK;
       status = KARST_FindEntry(&query, 1, &header, sizeof header)) {
    KARSTResolverNode *node = KARSTResolverFindOrCreateNode(cache, header.uuid);
    if (node == nullptr) continue;
    node->rescanSeen = 1;
    KARSTResolverNodeEntryFound(cache, node, &header);
  }
  KARSTRBTreeNode *next = nullptr;
  for (KARSTRBTreeNode *element = KARSTRBTree_First(cache->nodeTree); element != nullptr;
       element = next) {
    next = KARSTRBTree_Next(cache->nodeTree, element); /* now: the visit may remove the node */
    KARSTResolverNode *node = KARSTResolverNodeOfTreeElem(element);
    if (node->rescanSeen) {
      node->rescanSeen = 0;
    } else {
      KARSTResolverUpdateNodeHealthLocked(cache, node, false);
    }
  }
  KARSTResolverUnlockCache(cache);
}

static void KARSTResolverNodeAddedOrChanged(KARSTResolverCache *cache, zel_UUID uuid)
    KARST_EXCLUDES(karstResolverCacheLock) {
  KARSTResolverLockCache(cache);
  KARSTResolverNode *node = KARSTResolverFindOrCreateNode(cache, uuid);
  /* The entry is looked up afresh: by now there may be a newer one than the call told of. */
  if (node != nullptr) KARSTResolverNodeEntryFound(cache, node, nullptr);
  KARSTResolverUnlockCache(cache);
}

static void KARSTResolverNodeRemoved(KARSTResolverCache *cache, zel_UUID uuid)
    KARST_EXCLUDES(karstResolverCacheLock) {
  KARSTResolverLockCache(cache);
  KARSTResolverNode *node = KARSTResolverFindNodeLocked(cache, uuid);
  if (node != nullptr) KARSTResolverUpdateNodeHealthLocked(cache, node, false);
  KARSTResolverUnlockCache(cache);
}

zel_Status KARSTResolverNodeSubCbk(void *data, const KarstEntryHeader *header, void *,
                                   zel_Status status) {
  KARSTResolverCache *cache = (KARSTResolverCache *)data;
  switch (status) {
    case ZEL_SUB_CANCELLED:
      KARSTResolverCountDown(&cache->refCount); /* the cache may be gone from here on */
      break;
    case ZEL_SUB_RESYNC:
    case ZEL_SUB_OVERFLOW:
      KARSTResolverRescanNodes(cache);
      break;
    case ZEL_OK:
      KARSTResolverNodeAddedOrChanged(cache, header->uuid);
      break;
    case ZEL_NOT_FOUND:
      KARSTResolverNodeRemoved(cache, header->uuid);
      break;
    default:
      break;
  }
  return ZEL_OK;
}

} /* extern "C" */
