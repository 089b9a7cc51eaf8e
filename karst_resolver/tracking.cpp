/* Object and node tracking; see tracking.h. Takes the cache lock, then the instance lock. */
#include "karst_resolver/tracking.h"

#include "karst_resolver/instance.h"
#include "karst_resolver/node.h"
#include "karst_resolver/trace.h"

extern "C" {

/* Is there nothing to do? Without a lock: whatever slips through is decided again under it. */
static bool KARSTResolverTracksAlready(const KARSTResolverInstance *instance,
                                       const zel_UUID *nodeUUID) {
  if (KARSTResolverIsNodeChanged(instance)) return true;
  zel_UUID tracked = KARSTResolverTrackedNodeUUID(instance);
  return KARSTResolverUUIDEqual(&tracked, nodeUUID); /* both may be none */
}

/* May the instance attach to this node? Asked for a second one, it never will again. */
static bool KARSTResolverMayAttach(KARSTResolverInstance *instance, const zel_UUID *nodeUUID)
    KARST_REQUIRES(karstResolverCacheLock) {
  if (!KARSTResolverUUIDIsPresent(nodeUUID)) return false;
  if (!KARSTResolverUUIDIsPresent(&instance->boundNodeUUID)) return true;
  if (KARSTResolverUUIDEqual(&instance->boundNodeUUID, nodeUUID)) return true;
  __atomic_store_n(&instance->nodeChanged, 1, __ATOMIC_RELAXED);
  return false;
}

static void KARSTResolverChangeNode(KARSTResolverCache *cache, KARSTResolverInstance *instance,
                                    zel_UUID nodeUUID) KARST_REQUIRES(karstResolverCacheLock) {
  bool attach = KARSTResolverMayAttach(instance, &nodeUUID);
  if (instance->node != nullptr) KARSTResolverDetach(cache, instance);
  if (attach) {
    KARSTResolverNode *node = KARSTResolverFindOrCreateNode(cache, nodeUUID);
    if (node != nullptr) {
      KARSTResolverAttach(instance, node);
      /* Written once: a second attach is to the same node, and would be a race with quick looks. */
      if (!KARSTResolverUUIDIsPresent(&instance->boundNodeUUID)) instance->boundNodeUUID = nodeUUID;
    }
  }
  KARST_RESOLVER_TRACE(TrackNode, 220, KARST_RESOLVER_TRACE_POINTER(instance), instance->entryType,
                       KARST_RESOLVER_TRACE_UUID(&instance->objectUUID),
                       instance->node ? KARSTResolverUUIDLow(&instance->node->uuid) : 0,
                       instance->node ? KARSTResolverUUIDHigh(&instance->node->uuid) : 0);
}

void KARSTResolverTrackNode(KARSTResolverInstance *instance, zel_UUID nodeUUID) {
  if (KARSTResolverTracksAlready(instance, &nodeUUID)) return;

  KARSTResolverCache *cache = karstResolverCache;
  KARSTResolverLockCache(cache);
  KARSTResolverLockInstance(instance);
  bool destroyed = instance->destroyed;
  KARSTResolverUnlockInstance(instance);
  if (destroyed) {
    KARSTResolverUnlockCache(cache);
    return;
  }
  KARSTResolverChangeNode(cache, instance, nodeUUID);
  KARSTResolverLockInstance(instance);
  KARSTResolverUpdateAddressesLocked(instance);
  KARSTResolverUnlockInstance(instance);
  KARSTResolverUnlockCache(cache);
  KARSTResolverInvokeCallback(instance);
}

/* The six payload words of ObjectUpdated and ObjectDisappeared. */
#define OBJECT_PAYLOAD(instance, trackedNodeUUID)                \
  KARST_RESOLVER_TRACE_POINTER(instance), (instance)->entryType, \
      KARST_RESOLVER_TRACE_UUID(&(instance)->objectUUID),        \
      KARST_RESOLVER_TRACE_UUID(trackedNodeUUID)

void KARSTResolverUpdateObject(KARSTResolverInstance *instance, const KarstEntryHeader *entry) {
  zel_UUID tracked = KARSTResolverTrackedNodeUUID(instance);
  KarstEntryHeader found;
  if (entry == nullptr) {
    if (KARST_FindEntry(&instance->objectQuery, 0, &found, sizeof found) != ZEL_OK) {
      if (instance->useHintNode) {
        KARSTResolverTrackNode(instance, instance->hintNodeUUID);
        return;
      }
      KARST_RESOLVER_TRACE(ObjectDisappeared, 330, OBJECT_PAYLOAD(instance, &tracked));
      KARSTResolverTrackNode(instance, zel_UUID{});
      return;
    }
    entry = &found;
  }
  KARST_RESOLVER_TRACE(ObjectUpdated, 315, OBJECT_PAYLOAD(instance, &tracked));
  KARSTResolverTrackNode(instance, entry->owner);
  instance->useHintNode = 0; /* found once: the hint has served */
}

zel_Status KARSTResolverObjectSubCbk(void *callbackData, const KarstEntryHeader *entry, void *,
                                     zel_Status status) {
  KARSTResolverInstance *instance = (KARSTResolverInstance *)callbackData;
  if (status == ZEL_SUB_CANCELLED) {
    KARSTResolverReleaseInstance(instance); /* perhaps the last reference */
  } else if (!KARSTResolverIsDestroyed(instance)) {
    KARSTResolverUpdateObject(instance, status == ZEL_OK ? entry : nullptr);
  }
  return ZEL_OK;
}

} /* extern "C" */
