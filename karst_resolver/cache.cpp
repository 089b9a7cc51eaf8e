/* The cache's life; see cache.h. */
#include "karst_resolver/cache.h"

#include "karst_resolver/log.h"
#include "karst_resolver/netif.h"
#include "karst_resolver/node.h"
#include "karst_resolver/records.h"
#include "karst_resolver/world.h"
#include "platform/tolm.h"

extern "C" {

zel_LockDomainID karstResolverLockDomain = ZEL_NO_LOCK_DOMAIN;

zel_Status KARSTResolverLockCreate(KARSTResolverLock *lock, const char *name, uint16_t rank) {
  zel_SpinlockProps props = {};
  props.moduleID = karstResolverModuleID;
  props.heap = karstResolverHeapID;
  zel_NameInitialize(&props.name, name);
  props.type = ZEL_SPINLOCK_RANKED;
  props.domain = karstResolverLockDomain;
  props.rank = rank;
  return zel_SpinlockCreate(&props, &lock->handle);
}

/* ---- Enable and disable ---------------------------------------------------------------------- */

/* From `enabled` on clients may create nodes: those that came before this host's UUID was known learn
 * only here whether they are this host. */
static void KARSTResolverLearnSelf(KARSTResolverCache *cache, const zel_UUID *self)
    KARST_REQUIRES(karstResolverCacheLock) {
  cache->selfUUID = *self;
  for (KARSTRBTreeNode *element = KARSTRBTree_First(cache->nodeTree); element != nullptr;
       element = KARSTRBTree_Next(cache->nodeTree, element)) {
    KARSTResolverNode *node = KARSTResolverNodeOfTreeElem(element);
    node->isSelf = KARSTResolverUUIDEqual(&node->uuid, self);
  }
}

/* The steps of an enable until one fails. A function of its own, so that the reports of all of them
 * carry its name. */
static bool KARSTResolverCacheEnable(KARSTResolverCache *cache)
    KARST_EXCLUDES(karstResolverCacheLock) {
  KARSTResolverLockCache(cache);
  cache->enabled = 1;
  KARSTResolverUnlockCache(cache);

  zel_UUID self = {};
  KARST_GetSelfUUID(&self);
  KARSTResolverLockCache(cache);
  KARSTResolverLearnSelf(cache, &self);
  KARSTResolverUnlockCache(cache);

  zel_Status status = TOLM_WorldCreate(&cache->world, "KARSTResolverCache", karstResolverModuleID,
                                       KARSTResolverCacheWorldMain, cache, 1, karstResolverHeapID);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to create world: %s\n", zel_StatusToString(status));
    return false;
  }

  /* The queries are filled once. A subscription of an earlier enable may still have calls due,
   * which read them; and what a subscription was made with stays unchanged until its last call. */
  if (cache->nodeSub.type == 0) {
    KARSTResolverFillQuery(&cache->nodeSub, KARST_TYPE_NODE, KARST_RESOLVER_QUERY_ALL, nullptr);
    KARSTResolverFillQuery(&cache->netIfSub, KARST_TYPE_NET_INTERFACE, KARST_RESOLVER_QUERY_ALL,
                           nullptr);
  }
  KARSTResolverCountUp(&cache->refCount);
  status = KARST_Subscribe(&cache->nodeSub, KARSTResolverNodeSubCbk, cache);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to install node subscription: %s\n", zel_StatusToString(status));
    KARSTResolverCountDown(&cache->refCount);
    return false;
  }
  KARSTResolverCountUp(&cache->refCount);
  status = KARST_Subscribe(&cache->netIfSub, KARSTResolverNetIfSubCbk, cache);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to install netif subscription: %s\n", zel_StatusToString(status));
    KARSTResolverCountDown(&cache->refCount);
    return false;
  }
  return true;
}

/* No node reachable, no interface left. */
static void KARSTResolverForgetEntries(KARSTResolverCache *cache)
    KARST_REQUIRES(karstResolverCacheLock) {
  KARSTRBTreeNode *nextElement = nullptr;
  for (KARSTRBTreeNode *element = KARSTRBTree_First(cache->nodeTree); element != nullptr;
       element = nextElement) {
    nextElement = KARSTRBTree_Next(cache->nodeTree, element); /* the visit may remove the node */
    KARSTResolverUpdateNodeHealthLocked(cache, KARSTResolverNodeOfTreeElem(element), false);
  }
  KARSTResolverLink *nextLink = nullptr;
  for (KARSTResolverLink *link = cache->netIfs.next; link != &cache->netIfs; link = nextLink) {
    nextLink = link->next; /* the visit takes the interface off the list */
    KARSTResolverDestroyNetIf(cache,
                              KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, cacheLinks));
  }
}

void KARSTResolverCacheDisable(KARSTResolverCache *cache) {
  KARSTResolverLockCache(cache);
  if (!cache->enabled) {
    KARSTResolverUnlockCache(cache);
    return;
  }
  cache->enabled = 0; /* from here on nobody queues work for the world that goes away */
  KARSTResolverUnlockCache(cache);

  TOLM_WorldDestroy(&cache->world);
  KARST_Unsubscribe(&cache->netIfSub, KARSTResolverNetIfSubCbk, cache);
  KARST_Unsubscribe(&cache->nodeSub, KARSTResolverNodeSubCbk, cache);

  KARSTResolverLockCache(cache);
  KARSTResolverForgetEntries(cache);
  KARSTResolverUnlockCache(cache);
}

void KARSTResolverCacheEnableDisable(void *data, uint32_t status) {
  KARSTResolverCache *cache = (KARSTResolverCache *)data;
  if ((status & KARST_STATUS_USABLE) && KARSTResolverCacheEnable(cache)) return;
  KARSTResolverCacheDisable(cache);
}

/* ---- Creation and end ------------------------------------------------------------------------ */

/* The unchecked functions run while no other thread knows the cache: before it is registered
 * anywhere, and after the last reference on it is gone. */

static bool KARSTResolverCreateNodePool(KARSTResolverCache *cache) KARST_UNCHECKED {
  cache->nodePool = (KARSTResolverNode *)KARSTResolverAlloc(KARST_RESOLVER_NODE_POOL_SIZE *
                                                            sizeof(KARSTResolverNode));
  if (cache->nodePool == nullptr) return false;
  for (uint32_t i = 0; i < KARST_RESOLVER_NODE_POOL_SIZE; i++) {
    KARSTResolverTagFree(cache->nodePool[i].tag, KARST_RESOLVER_TAG_NODE);
    KARSTResolverListAppend(&cache->freeNodes, &cache->nodePool[i].freeLinks);
  }
  return true;
}

static bool KARSTResolverCreateNetIfPool(KARSTResolverCache *cache) KARST_UNCHECKED {
  cache->netIfPool = (KARSTResolverNetIf *)KARSTResolverAlloc(KARST_RESOLVER_NETIF_POOL_SIZE *
                                                              sizeof(KARSTResolverNetIf));
  if (cache->netIfPool == nullptr) return false;
  for (uint32_t i = 0; i < KARST_RESOLVER_NETIF_POOL_SIZE; i++) {
    KARSTResolverTagFree(cache->netIfPool[i].tag, KARST_RESOLVER_TAG_NETIF);
    KARSTResolverListAppend(&cache->freeNetIfs, &cache->netIfPool[i].freeLinks);
  }
  return true;
}

/* Everything that the cache consists of, until something cannot be had. */
static zel_Status KARSTResolverCacheBuild(KARSTResolverCache *cache,
                                          const char *function) KARST_UNCHECKED {
  KARSTResolverTagInUse(cache->tag, KARST_RESOLVER_TAG_CACHE);
  cache->lock.handle = ZEL_NO_SPINLOCK;
  KARSTResolverListInit(&cache->freeNodes);
  KARSTResolverListInit(&cache->freeNetIfs);
  KARSTResolverListInit(&cache->netIfs);
  KARSTResolverListInit(&cache->dirtyNodes);

  zel_Status status =
      KARSTResolverLockCreate(&cache->lock, "KARSTResolverCache", KARST_RESOLVER_RANK_CACHE);
  if (status != ZEL_OK) {
    cache->lock.handle = ZEL_NO_SPINLOCK; /* whatever a failed creation may have stored */
    KARST_RESOLVER_REPORT_AS(function, "Failed to create spinlock: %s\n",
                             zel_StatusToString(status));
    return status;
  }
  if (!KARSTResolverCreateNodePool(cache)) {
    KARST_RESOLVER_REPORT_AS(function, "Failed to allocate node pool\n");
    return ZEL_NO_MEMORY;
  }
  if (!KARSTResolverCreateNetIfPool(cache)) {
    KARST_RESOLVER_REPORT_AS(function, "Failed to allocate netif pool\n");
    return ZEL_NO_MEMORY;
  }
  cache->nodeTree = KARSTRBTree_AllocTreeEx(&karstResolverMemPool);
  if (cache->nodeTree == nullptr) {
    KARST_RESOLVER_REPORT_AS(function, "Failed to allocate node rbtree\n");
    return ZEL_NO_MEMORY;
  }
  return ZEL_OK;
}

zel_Status KARSTResolverCacheInit(KARSTResolverCache **result) {
  *result = nullptr;
  KARSTResolverCache *cache = (KARSTResolverCache *)KARSTResolverAlloc(sizeof(KARSTResolverCache));
  if (cache == nullptr) return ZEL_NO_MEMORY;
  zel_Status status = KARSTResolverCacheBuild(cache, __func__);
  if (status == ZEL_OK &&
      KARST_RegisterStatusCallback(KARSTResolverCacheEnableDisable, cache) != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to register KARST status callback\n");
    status = ZEL_FAILURE;
  }
  if (status != ZEL_OK) {
    KARSTResolverCacheCleanup(cache);
    return status;
  }
  *result = cache;
  return ZEL_OK;
}

/* Returns when every subscription has had its last call and every instance is back on the heap. */
static void KARSTResolverCacheWaitUntilUnused(KARSTResolverCache *cache)
    KARST_EXCLUDES(karstResolverCacheLock) {
  while (__atomic_load_n(&cache->refCount, __ATOMIC_ACQUIRE) != 0 ||
         __atomic_load_n(&karstResolverInstancesAlive, __ATOMIC_ACQUIRE) != 0) {
    zel_WorldSleep(100000);
  }
}

void KARSTResolverCacheCleanup(KARSTResolverCache *cache) KARST_UNCHECKED {
  KARST_DeregisterStatusCallback(KARSTResolverCacheEnableDisable, cache);
  bool lockExists = cache->lock.handle != ZEL_NO_SPINLOCK;
  if (lockExists) KARSTResolverCacheDisable(cache);
  KARSTResolverCacheWaitUntilUnused(cache);
  if (lockExists) {
    /* Whoever gave the last reference back under the lock may not have left it yet. */
    KARSTResolverLockCache(cache);
    KARSTResolverUnlockCache(cache);
  }
  if (cache->nodeTree != nullptr) KARSTRBTree_FreeTree(cache->nodeTree);
  cache->nodeTree = nullptr;
  if (cache->nodePool != nullptr) KARSTResolverFree(cache->nodePool);
  cache->nodePool = nullptr;
  if (cache->netIfPool != nullptr) KARSTResolverFree(cache->netIfPool);
  cache->netIfPool = nullptr;
  if (lockExists) zel_SpinlockDestroy(cache->lock.handle);
  cache->lock.handle = ZEL_NO_SPINLOCK;
  KARSTResolverTagFree(cache->tag, KARST_RESOLVER_TAG_CACHE);
  KARSTResolverFree(cache);
}

} /* extern "C" */
