/* Network interface tracking; see netif.h. Under the cache lock. */
#include "karst_resolver/netif.h"

#include "karst_resolver/log.h"
#include "karst_resolver/node.h"
#include "karst_resolver/records.h"
#include "karst_resolver/trace.h"

extern "C" {

/* ---- Finding and creating -------------------------------------------------------------------- */

KARSTResolverNetIf *KARSTResolverFindNetIf(KARSTResolverCache *cache, zel_UUID nodeUUID,
                                           zel_UUID netIfUUID) {
  KARSTResolverNode *node = KARSTResolverFindNodeLocked(cache, nodeUUID);
  if (node == nullptr) return nullptr;
  for (KARSTResolverLink *link = node->netIfList.next; link != &node->netIfList;
       link = link->next) {
    KARSTResolverNetIf *netIf = KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, nodeLinks);
    if (KARSTResolverUUIDEqual(&netIf->uuid, &netIfUUID)) return netIf;
  }
  return nullptr;
}

KARSTResolverNetIf *KARSTResolverFindOrCreateNetIf(KARSTResolverCache *cache, zel_UUID nodeUUID,
                                                   zel_UUID netIfUUID) {
  if (!cache->enabled) return nullptr;
  KARSTResolverNetIf *netIf = KARSTResolverFindNetIf(cache, nodeUUID, netIfUUID);
  if (netIf != nullptr) return netIf;
  if (KARSTResolverListIsEmpty(&cache->freeNetIfs)) return nullptr;
  KARSTResolverNode *node = KARSTResolverFindOrCreateNode(cache, nodeUUID);
  if (node == nullptr) return nullptr;

  netIf = KARST_RESOLVER_CONTAINER(KARSTResolverListPopFront(&cache->freeNetIfs),
                                   KARSTResolverNetIf, freeLinks);
  __builtin_memset((void *)netIf, 0, sizeof *netIf);
  netIf->uuid = netIfUUID;
  KARSTResolverTagInUse(netIf->tag, KARST_RESOLVER_TAG_NETIF);
  netIf->refCount = 1;
  zel_Snprintf(netIf->uuidString, sizeof netIf->uuidString, KARST_RESOLVER_UUID_FORMAT,
               KARST_RESOLVER_UUID_BYTES(netIf->uuid));
  KARSTResolverFillQuery(&netIf->healthSub, KARST_TYPE_HEALTH_STATUS, KARST_RESOLVER_QUERY_ONE,
                         &netIf->uuid);
  netIf->cache = cache;
  KARSTResolverListAppend(&cache->netIfs, &netIf->cacheLinks);
  cache->unwatchedNetIfs++;
  node->refCount++;
  netIf->node = node;
  KARSTResolverListAppend(&node->netIfList, &netIf->nodeLinks);
  KARST_RESOLVER_TRACE(AddNetIfToCache, 150, KARST_RESOLVER_TRACE_POINTER(netIf),
                       KARST_RESOLVER_TRACE_UUID(&netIf->uuid),
                       KARST_RESOLVER_TRACE_UUID(&node->uuid));
  /* Its health subscription is the world's to install: that may be more than a directory thread
   * should do under the lock. */
  KARSTResolverUpdateNetIfHealth(cache, netIf);
  return netIf;
}

/* ---- Reading entries ------------------------------------------------------------------------- */

zel_Status KARSTResolverUpdateNetIf(KARSTResolverCache *cache, KARSTResolverNetIf *netIf) {
  KarstQuery query = {};
  KARSTResolverFillQuery(&query, KARST_TYPE_NET_INTERFACE, KARST_RESOLVER_QUERY_ONE, &netIf->uuid);
  KarstFullEntry *entry = nullptr;
  if (KARST_FindFullEntryByQuery(&query, 0, &resolverMshAlloc, &entry) != ZEL_OK) {
    return ZEL_FAILURE;
  }
  zel_UUID owner = entry->header.owner;
  if (!KARSTResolverUUIDEqual(&owner, &netIf->node->uuid)) {
    KARSTResolverFreeEntry(entry);
    KARST_RESOLVER_REPORT("Netif owner changed to " KARST_RESOLVER_UUID_FORMAT "\n",
                          KARST_RESOLVER_UUID_BYTES(owner));
    return ZEL_FAILURE;
  }
  KarstNetInterfaceEntry record;
  zel_Status status = KARSTResolverDecodeEntry(entry, KarstNetInterfaceEntryTbl,
                                               "KarstNetInterfaceEntry", &record, sizeof record);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to unmarshal netif entry %s: %s\n", netIf->uuidString,
                          zel_StatusToString(status));
    return ZEL_FAILURE;
  }
  /* An interface that names no traffic types carries all of them. */
  if (record.trafficTypeMask == 0) record.trafficTypeMask = ~0ull;
  if (__builtin_memcmp(&record, &netIf->info, sizeof record) == 0) return ZEL_OK;

  __builtin_memcpy(&netIf->info, &record, sizeof record);
  KARST_RESOLVER_TRACE(UpdateNetIfInfo, 304, KARST_RESOLVER_TRACE_POINTER(netIf),
                       KARST_RESOLVER_TRACE_UUID(&netIf->uuid),
                       KARST_RESOLVER_TRACE_UUID(&netIf->node->uuid));
  KARSTResolverMarkNodeDirty(cache, netIf->node);
  return ZEL_OK;
}

void KARSTResolverUpdateNetIfHealth(KARSTResolverCache *cache, KARSTResolverNetIf *netIf) {
  KarstHealthStatusEntry record;
  __builtin_memset(&record, 0xff, sizeof record); /* what stands for a missing entry: unhealthy */
  KarstQuery query = netIf->healthSub;
  KarstFullEntry *entry = nullptr;
  if (KARST_FindFullEntryByQuery(&query, 0, &resolverMshAlloc, &entry) == ZEL_OK) {
    zel_Status status = KARSTResolverDecodeEntry(entry, KarstHealthStatusEntryTbl,
                                                 "KarstHealthStatusEntry", &record, sizeof record);
    if (status != ZEL_OK) { /* goes on with what the decoder left */
      KARST_RESOLVER_REPORT("Failed to unmarshal health entry %s: %s\n", netIf->uuidString,
                            zel_StatusToString(status));
    }
  }
  bool changed = record.healthFlags != netIf->health.healthFlags;
  netIf->healthy = record.healthFlags == 0;
  netIf->health = record;
  if (!changed) return;
  KARST_RESOLVER_TRACE(UpdateNetIfHealth, 378, KARST_RESOLVER_TRACE_POINTER(netIf),
                       KARST_RESOLVER_TRACE_UUID(&netIf->uuid),
                       KARST_RESOLVER_TRACE_FLAG(netIf->healthy), netIf->health.healthFlags,
                       netIf->health.timestamp);
  KARSTResolverMarkNodeDirty(cache, netIf->node);
}

/* ---- Destroying ------------------------------------------------------------------------------ */

void KARSTResolverReleaseNetIf(KARSTResolverCache *cache, KARSTResolverNetIf *netIf) {
  KARST_RESOLVER_CHECK(netIf->refCount != 0);
  if (--netIf->refCount != 0) return;
  __builtin_memset((void *)netIf, 0, sizeof *netIf);
  KARSTResolverTagFree(netIf->tag, KARST_RESOLVER_TAG_NETIF);
  KARSTResolverListAppend(&cache->freeNetIfs, &netIf->freeLinks);
}

void KARSTResolverDestroyNetIf(KARSTResolverCache *cache, KARSTResolverNetIf *netIf) {
  KARSTResolverNode *node = netIf->node;
  KARST_RESOLVER_TRACE(RemoveNetIfFromCache, 195, KARST_RESOLVER_TRACE_POINTER(netIf),
                       KARST_RESOLVER_TRACE_UUID(&netIf->uuid),
                       KARST_RESOLVER_TRACE_UUID(&node->uuid));
  KARSTResolverListUnlink(&netIf->cacheLinks);
  KARSTResolverListUnlink(&netIf->nodeLinks);
  KARSTResolverMarkNodeDirty(cache, node); /* it lost an interface */
  KARSTResolverReleaseNodeLocked(cache, node);
  netIf->node = nullptr;
  if (netIf->healthSubInstalled) {
    KARST_Unsubscribe(&netIf->healthSub, KARSTResolverNetIfHealthSubCbk, netIf);
    netIf->healthSubInstalled = 0;
  } else {
    cache->unwatchedNetIfs--;
  }
  KARSTResolverReleaseNetIf(cache, netIf);
}

/* ---- The health subscription of one interface ------------------------------------------------ */

zel_Status KARSTResolverNetIfHealthSubCbk(void *data, const KarstEntryHeader *, void *,
                                          zel_Status status) {
  KARSTResolverNetIf *netIf = (KARSTResolverNetIf *)data;
  KARSTResolverCache *cache = netIf->cache;
  KARSTResolverLockCache(cache);
  if (status == ZEL_SUB_CANCELLED) {
    KARSTResolverReleaseNetIf(cache, netIf);
    /* Perhaps the last one that unload waits for: it takes the lock once more before it frees. */
    KARSTResolverCountDown(&cache->refCount);
  } else if (netIf->node != nullptr) {
    KARSTResolverUpdateNetIfHealth(cache, netIf);
  }
  KARSTResolverUnlockCache(cache);
  return ZEL_OK;
}

/* ---- The subscription to all interface entries ----------------------------------------------- */

/* Changes were lost: afterwards the cached interfaces are those that are there, below the owners
 * that they have, and can be read. Time: O(entries * (log nodes + a node's interfaces)). */
static void KARSTResolverRescanNetIfs(KARSTResolverCache *cache)
    KARST_EXCLUDES(karstResolverCacheLock) {
  KARST_RESOLVER_TRACE(RescanNetIfs, 414, 0);
  KARSTResolverLockCache(cache);
  KarstQuery query =
      cache->netIfSub; /* the walk is the copy's; the installed query stays untouched */
  KarstEntryHeader header;
  for (zel_Status status = KARST_FindEntry(&query, 0, &header, sizeof header); status == ZEL_OK;
       status = KARST_FindEntry(&query, 1, &header, sizeof header)) {
    KARSTResolverNetIf *netIf = KARSTResolverFindOrCreateNetIf(cache, header.owner, header.uuid);
    if (netIf == nullptr) continue;
    if (KARSTResolverUpdateNetIf(cache, netIf) == ZEL_OK) {
      netIf->rescanSeen = 1;
    } else {
      KARSTResolverDestroyNetIf(cache, netIf);
    }
  }
  KARSTResolverLink *next = nullptr;
  for (KARSTResolverLink *link = cache->netIfs.next; link != &cache->netIfs; link = next) {
    next = link->next; /* now: the visit may take the interface off the list */
    KARSTResolverNetIf *netIf = KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, cacheLinks);
    if (netIf->rescanSeen) {
      netIf->rescanSeen = 0;
    } else {
      KARSTResolverDestroyNetIf(cache, netIf);
    }
  }
  KARSTResolverUnlockCache(cache);
}

zel_Status KARSTResolverNetIfSubCbk(void *data, const KarstEntryHeader *header, void *,
                                    zel_Status status) {
  KARSTResolverCache *cache = (KARSTResolverCache *)data;
  if (status == ZEL_SUB_CANCELLED) {
    KARSTResolverCountDown(&cache->refCount); /* the cache may be gone from here on */
    return ZEL_OK;
  }
  if (status == ZEL_SUB_RESYNC || status == ZEL_SUB_OVERFLOW) {
    KARSTResolverRescanNetIfs(cache);
    return ZEL_OK;
  }
  KARSTResolverLockCache(cache);
  if (status == ZEL_OK) {
    KARSTResolverNetIf *netIf = KARSTResolverFindOrCreateNetIf(cache, header->owner, header->uuid);
    if (netIf != nullptr && KARSTResolverUpdateNetIf(cache, netIf) != ZEL_OK) {
      KARSTResolverDestroyNetIf(cache, netIf);
    }
  } else if (status == ZEL_NOT_FOUND) {
    KARSTResolverNetIf *netIf = KARSTResolverFindNetIf(cache, header->owner, header->uuid);
    if (netIf != nullptr) KARSTResolverDestroyNetIf(cache, netIf);
  }
  KARSTResolverUnlockCache(cache);
  return ZEL_OK;
}

} /* extern "C" */
