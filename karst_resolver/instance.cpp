/* Refresh, callback and release of instances; see instance.h. Cache lock before instance lock, and
 * the client is called under the instance lock alone. */
#include "karst_resolver/instance.h"

#include "karst_resolver/node.h"
#include "karst_resolver/trace.h"
#include "platform/tolm.h"

extern "C" {

uint64_t karstResolverInstancesAlive;

/* ---- Looks without a lock -------------------------------------------------------------------- */

bool KARSTResolverIsDestroyed(const KARSTResolverInstance *instance) KARST_UNCHECKED {
  return __atomic_load_n(&instance->destroyed, __ATOMIC_RELAXED) != 0;
}

bool KARSTResolverIsNodeChanged(const KARSTResolverInstance *instance) KARST_UNCHECKED {
  return __atomic_load_n(&instance->nodeChanged, __ATOMIC_RELAXED) != 0;
}

bool KARSTResolverIsAttached(const KARSTResolverInstance *instance) KARST_UNCHECKED {
  return __atomic_load_n(&instance->node, __ATOMIC_RELAXED) != nullptr;
}

zel_UUID KARSTResolverTrackedNodeUUID(const KARSTResolverInstance *instance) {
  /* Never through the node: its slot may be somebody else's by now. */
  return KARSTResolverIsAttached(instance) ? instance->boundNodeUUID : zel_UUID{};
}

/* ---- Attaching ------------------------------------------------------------------------------- */

void KARSTResolverAttach(KARSTResolverInstance *instance, KARSTResolverNode *node) {
  KARSTResolverListPushFront(&node->instanceList, &instance->nodeLinks);
  node->refCount++;
  __atomic_store_n(&instance->node, node, __ATOMIC_RELAXED);
}

void KARSTResolverDetach(KARSTResolverCache *cache, KARSTResolverInstance *instance) {
  /* Off the node's list, or off the world's own while it refreshes that node's instances. */
  KARSTResolverListUnlink(&instance->nodeLinks);
  KARSTResolverReleaseNodeLocked(cache, instance->node);
  __atomic_store_n(&instance->node, (KARSTResolverNode *)nullptr, __ATOMIC_RELAXED);
}

/* ---- Refresh --------------------------------------------------------------------------------- */

void KARSTResolverUpdateAddressesLocked(KARSTResolverInstance *instance) {
  KARSTResolverNode *node = instance->node;
  KARSTResolverNodeLocators *own = &instance->locators;
  uint32_t state;
  if (instance->useLocalLocator && node != nullptr && node->isSelf) {
    /* This host reaches itself, whatever the directory says of its interfaces. */
    own->nodeUUID = node->uuid;
    own->majorVersion = node->majorVersion;
    own->minorVersion = node->minorVersion;
    own->trafficType = 0;
    own->count = 1;
    own->locators[0].networkType = KARST_RESOLVER_LOCATOR_LOCAL;
    state = KARST_RESOLVER_STATE_RESOLVED;
  } else if (node != nullptr && node->reachable && node->locators.count != 0) {
    __builtin_memcpy(own, &node->locators, sizeof *own);
    state = KARST_RESOLVER_STATE_RESOLVED;
  } else {
    __builtin_memset(own, 0, sizeof *own);
    state = KARST_RESOLVER_STATE_UNRESOLVED;
  }
  KARST_RESOLVER_TRACE(UpdateAddresses, 120, KARST_RESOLVER_TRACE_POINTER(instance),
                       KARST_RESOLVER_TRACE_UUID(&instance->objectUUID),
                       KARST_RESOLVER_TRACE_UUID(&own->nodeUUID), own->count);
  instance->state = state;
}

void KARSTResolverInvokeCallback(KARSTResolverInstance *instance) {
  KARSTResolverLockInstance(instance);
  if (instance->callback != nullptr) {
    KARST_RESOLVER_TRACE(InvokeCallback, 39, KARST_RESOLVER_TRACE_POINTER(instance),
                         instance->entryType, KARST_RESOLVER_TRACE_UUID(&instance->objectUUID),
                         KARST_RESOLVER_TRACE_POINTER(instance->callback),
                         instance->locators.count);
    instance->callback(instance->callbackData, instance, instance->state);
  }
  KARSTResolverUnlockInstance(instance);
}

void KARSTResolverRefreshNodeLocation(KARSTResolverInstance *instance, KARSTResolverNode *node) {
  KARSTResolverCache *cache = karstResolverCache;
  KARSTResolverLockCache(cache);
  if (instance->node != node) { /* moved away, or destroyed, since the world picked it up */
    KARSTResolverUnlockCache(cache);
    return;
  }
  KARSTResolverLockInstance(instance);
  KARSTResolverUpdateAddressesLocked(instance);
  KARSTResolverUnlockInstance(instance);
  KARSTResolverUnlockCache(cache);
  KARSTResolverInvokeCallback(instance);
}

uint32_t KARSTResolverReadState(KARSTResolverInstance *instance) {
  KARSTResolverLockInstance(instance);
  uint32_t state = instance->state;
  KARSTResolverUnlockInstance(instance);
  return state;
}

/* ---- Release --------------------------------------------------------------------------------- */

KARST_RESOLVER_RECORDS_CALLER void KARSTResolverReleaseInstance(KARSTResolverInstance *instance) {
  uint64_t before = KARSTResolverCountDown(&instance->refCount);
  KARST_RESOLVER_TRACE(ReleaseInstance, 384, KARST_RESOLVER_TRACE_POINTER(instance), before,
                       KARST_RESOLVER_TRACE_POINTER(__builtin_return_address(0)),
                       tolmapi_GetReturnAddress(1), tolmapi_GetReturnAddress(2),
                       tolmapi_GetReturnAddress(3));
  if (before != 1) return;
  zel_SpinlockDestroy(instance->lock.handle);
  KARSTResolverTagFree(instance->tag, KARST_RESOLVER_TAG_INSTANCE);
  KARSTResolverFree(instance);
  KARSTResolverCountDown(
      &karstResolverInstancesAlive); /* last: unload may free the heap after it */
}

} /* extern "C" */
