/* The cache world; see world.h. Takes the cache lock, and gives it up for every refresh and
 * whenever somebody else is due. */
#include "karst_resolver/world.h"

#include "karst_resolver/instance.h"
#include "karst_resolver/locators.h"
#include "karst_resolver/netif.h"
#include "karst_resolver/node.h"
#include "platform/tolm.h"

extern "C" {

/* Subscribes to the health of interfaces that came since the last cycle. One that cannot be had is
 * tried again in the next. The references are taken first: the last call may come at any time. */
static void KARSTResolverInstallHealthSubs(KARSTResolverCache *cache)
    KARST_REQUIRES(karstResolverCacheLock) {
  if (cache->unwatchedNetIfs == 0) return; /* no walk over all interfaces for one that changed */
  for (KARSTResolverLink *link = cache->netIfs.next; link != &cache->netIfs; link = link->next) {
    KARSTResolverNetIf *netIf = KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, cacheLinks);
    if (netIf->healthSubInstalled) continue;
    KARSTResolverCountUp(&cache->refCount);
    netIf->refCount++;
    if (KARST_Subscribe(&netIf->healthSub, KARSTResolverNetIfHealthSubCbk, netIf) == ZEL_OK) {
      netIf->healthSubInstalled = 1;
      cache->unwatchedNetIfs--;
    } else {
      netIf->refCount--; /* its place in the cache keeps it alive */
      KARSTResolverCountDown(&cache->refCount);
    }
  }
}

/* Refreshes every instance of a node that is up to date. The instances wait on a list of the
 * world's own, so that the walk stands while the lock is given up: those that attach meanwhile join
 * the node's list, up to date already; those that leave take themselves off this one. */
static void KARSTResolverRefreshInstances(KARSTResolverCache *cache, KARSTResolverNode *node)
    KARST_REQUIRES(karstResolverCacheLock) {
  KARSTResolverLink pending;
  node->refCount++; /* keeps the node while the lock is given up */
  KARSTResolverListMoveAll(&node->instanceList, &pending);
  while (!KARSTResolverListIsEmpty(&pending)) {
    KARSTResolverInstance *instance =
        KARST_RESOLVER_CONTAINER(pending.next, KARSTResolverInstance, nodeLinks);
    KARSTResolverCountUp(&instance->refCount); /* keeps the instance likewise */
    KARSTResolverUnlockCache(cache);
    KARSTResolverRefreshNodeLocation(instance, node);
    KARSTResolverLockCache(cache);
    if (instance->node == node) {
      KARSTResolverListUnlink(&instance->nodeLinks);
      KARSTResolverListPushFront(&node->instanceList, &instance->nodeLinks);
    }
    KARSTResolverReleaseInstance(instance); /* frees it if it was destroyed during its refresh */
  }
  KARSTResolverReleaseNodeLocked(cache, node);
}

/* Works the queue off. True when it is empty, false when somebody else is due first. */
static bool KARSTResolverProcessDirtyNodes(KARSTResolverCache *cache)
    KARST_REQUIRES(karstResolverCacheLock) {
  for (;;) {
    if (tolmapi_PreemptionIsPending()) return false;
    if (KARSTResolverListIsEmpty(&cache->dirtyNodes)) return true;
    /* Off the queue before it is looked at: a change from now on queues it again. */
    KARSTResolverNode *node = KARST_RESOLVER_CONTAINER(
        KARSTResolverListPopFront(&cache->dirtyNodes), KARSTResolverNode, dirtyLinks);
    KARSTResolverGenerateNodeLocators(cache, node);
    if (!KARSTResolverListIsEmpty(&node->instanceList)) KARSTResolverRefreshInstances(cache, node);
  }
}

uint32_t KARSTResolverCacheWorldMain(void *data) {
  KARSTResolverCache *cache = (KARSTResolverCache *)data;
  tolmapi_PreemptionEnable();
  for (;;) {
    KARSTResolverLockCache(cache);
    KARSTResolverInstallHealthSubs(cache);
    bool done = KARSTResolverProcessDirtyNodes(cache);
    KARSTResolverUnlockCache(cache);
    if (!done) continue;
    if (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "KARSTResolverCacheWorld") ==
        ZEL_WORLD_STOPPING) {
      return 0;
    }
  }
}

} /* extern "C" */
