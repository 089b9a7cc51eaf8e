/* The four exported functions; see karst_resolver.h. Called on clients' threads without a lock. */
#include "karst_resolver/cache.h"
#include "karst_resolver/instance.h"
#include "karst_resolver/log.h"
#include "karst_resolver/model.h"
#include "karst_resolver/records.h"
#include "karst_resolver/trace.h"
#include "karst_resolver/tracking.h"

#define EXPORTED __attribute__((visibility("default")))

extern "C" {

/* ---- Create ---------------------------------------------------------------------------------- */

/* Nobody else knows the instance yet, so its fields need no lock. */
static void KARSTResolverInitInstance(KARSTResolverInstance *instance, uint32_t entryType,
                                      const zel_UUID *objectUUID, const zel_UUID *nodeUUID,
                                      bool useLocalLocator) KARST_UNCHECKED {
  KARSTResolverTagInUse(instance->tag, KARST_RESOLVER_TAG_INSTANCE);
  instance->refCount = 1;
  instance->objectUUID = *objectUUID;
  instance->state = KARST_RESOLVER_STATE_INIT;
  instance->nodeChanged = 0;
  instance->entryType = entryType;
  instance->useLocalLocator = useLocalLocator;
  if (KARSTResolverUUIDIsPresent(objectUUID)) {
    instance->hintNodeUUID = *nodeUUID;
    instance->useHintNode = KARSTResolverUUIDIsPresent(nodeUUID);
    KARSTResolverFillQuery(&instance->objectQuery, (uint8_t)entryType, KARST_RESOLVER_QUERY_ONE,
                           objectUUID);
    zel_Snprintf(instance->name, sizeof instance->name, "object:" KARST_RESOLVER_UUID_FORMAT,
                 KARST_RESOLVER_UUID_BYTES(*objectUUID));
  } else {
    zel_Snprintf(instance->name, sizeof instance->name, "node:" KARST_RESOLVER_UUID_FORMAT,
                 KARST_RESOLVER_UUID_BYTES(*nodeUUID));
  }
}

/* Follows the object's entry from now on; the instance is tracked already, so that its first
 * tracking cannot overlap a call of the subscription. */
static zel_Status KARSTResolverSubscribeObject(KARSTResolverInstance *instance,
                                               const char *function) {
  KARSTResolverCountUp(&instance->refCount); /* the subscription's; its last call gives it back */
  zel_Status status = KARST_Subscribe(&instance->objectQuery, KARSTResolverObjectSubCbk, instance);
  if (status == ZEL_OK) {
    instance->subscribed = 1;
    return ZEL_OK;
  }
  KARST_RESOLVER_NOTE_AS(function, "Failed to install object subscription: %s\n",
                         zel_StatusToString(status));
  KARSTResolverReleaseInstance(instance);
  return status;
}

EXPORTED zel_Status KARSTResolver_Create(KARSTResolverInstance **result, uint32_t entryType,
                                         zel_UUID objectUUID, zel_UUID nodeUUID,
                                         bool useLocalLocator) {
  bool objectGiven = KARSTResolverUUIDIsPresent(&objectUUID);
  bool nodeGiven = KARSTResolverUUIDIsPresent(&nodeUUID);
  if (result == nullptr || (!objectGiven && !nodeGiven)) return ZEL_BAD_PARAM;
  KARSTResolverCache *cache = karstResolverCache;
  if (cache == nullptr) return ZEL_NOT_INITIALIZED;

  KARSTResolverInstance *instance =
      (KARSTResolverInstance *)KARSTResolverAlloc(sizeof(KARSTResolverInstance));
  if (instance == nullptr) return ZEL_NO_MEMORY;
  KARSTResolverInitInstance(instance, entryType, &objectUUID, &nodeUUID, useLocalLocator);
  zel_Status status = KARSTResolverLockCreate(&instance->lock, "KARSTResolverInstance",
                                              KARST_RESOLVER_RANK_INSTANCE);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT("Failed to create spinlock: %s\n", zel_StatusToString(status));
    KARSTResolverTagFree(instance->tag, KARST_RESOLVER_TAG_INSTANCE);
    KARSTResolverFree(instance);
    return status;
  }
  KARSTResolverCountUp(&karstResolverInstancesAlive);
  KARSTResolverLockCache(cache);
  KARSTResolverCountUp(&cache->refCount);
  KARSTResolverUnlockCache(cache);
  KARST_RESOLVER_TRACE(CreateInstance, 485, KARST_RESOLVER_TRACE_POINTER(instance), entryType,
                       KARST_RESOLVER_TRACE_UUID(&objectUUID),
                       KARST_RESOLVER_TRACE_UUID(&nodeUUID));

  if (objectGiven) {
    KARSTResolverUpdateObject(instance, nullptr);
  } else {
    KARSTResolverTrackNode(instance, nodeUUID);
  }
  status = ZEL_OK;
  if (KARSTResolverReadState(instance) != KARST_RESOLVER_STATE_RESOLVED) {
    status = ZEL_NOT_FOUND;
  } else if (objectGiven) {
    status = KARSTResolverSubscribeObject(instance, __func__);
  }
  if (status != ZEL_OK) {
    KARSTResolver_Destroy(instance);
    return status;
  }
  *result = instance;
  return ZEL_OK;
}

/* ---- Destroy, callback, read-out ------------------------------------------------------------- */

EXPORTED void KARSTResolver_Destroy(KARSTResolverInstance *instance) {
  KARSTResolverCache *cache = karstResolverCache;
  KARSTResolverCountUp(&karstResolverInstancesAlive);
  zel_UUID tracked = KARSTResolverTrackedNodeUUID(instance);
  KARST_RESOLVER_TRACE(DestroyInstance, 547, KARST_RESOLVER_TRACE_POINTER(instance),
                       instance->entryType, KARST_RESOLVER_TRACE_UUID(&instance->objectUUID),
                       KARST_RESOLVER_TRACE_UUID(&tracked));
  if (instance->subscribed) {
    KARST_Unsubscribe(&instance->objectQuery, KARSTResolverObjectSubCbk, instance);
    instance->subscribed = 0;
  }
  KARSTResolverLockCache(cache);
  /* A callback that runs has this lock: it ends first, and none begins without a callback. */
  KARSTResolverLockInstance(instance);
  instance->callback = nullptr;
  instance->callbackData = nullptr;
  __atomic_store_n(&instance->destroyed, 1, __ATOMIC_RELAXED);
  KARSTResolverUnlockInstance(instance);
  if (instance->node != nullptr) KARSTResolverDetach(cache, instance);
  KARSTResolverCountDown(&cache->refCount);
  KARSTResolverUnlockCache(cache);
  KARSTResolverReleaseInstance(instance);
  KARSTResolverCountDown(&karstResolverInstancesAlive); /* last: the module may go after it */
}

EXPORTED void KARSTResolver_SetCallback(KARSTResolverInstance *instance,
                                        KARSTResolverCallback callback, void *callbackData) {
  KARSTResolverLockInstance(instance);
  if (!instance->destroyed) {
    instance->callback = callback;
    instance->callbackData = callbackData;
    KARST_RESOLVER_TRACE(SetCallback, 621, KARST_RESOLVER_TRACE_POINTER(instance),
                         KARST_RESOLVER_TRACE_POINTER(callback),
                         KARST_RESOLVER_TRACE_POINTER(callbackData));
  }
  KARSTResolverUnlockInstance(instance);
  KARSTResolverInvokeCallback(instance);
}

EXPORTED zel_Status KARSTResolver_GetNodeLocators(KARSTResolverInstance *instance,
                                                  KARSTResolverNodeLocators *nodeLocators) {
  KARSTResolverLockInstance(instance);
  if (instance->state != KARST_RESOLVER_STATE_RESOLVED) {
    KARSTResolverUnlockInstance(instance);
    return ZEL_NOT_FOUND;
  }
  const KARSTResolverNodeLocators *own = &instance->locators;
  /* Copied in line and in large pieces, for clients do this most of all: first what lies together at
   * the start, the UUID and both versions; at last, as most nodes have them, all slots at once, up to
   * the next 16 bytes and then by 16 each: no piece lies in two cache lines if the whole begins so. */
  __builtin_memcpy(nodeLocators, own, offsetof(KARSTResolverNodeLocators, reserved));
  nodeLocators->trafficType = own->trafficType;
  uint16_t count = nodeLocators->capacity < own->count ? nodeLocators->capacity : own->count;
  nodeLocators->count = count;
  if (count == KARST_RESOLVER_MAX_LOCATORS) {
    const size_t odd = 16 - offsetof(KARSTResolverNodeLocators, locators) % 16;
    const uint8_t *from = (const uint8_t *)own->locators;
    uint8_t *to = (uint8_t *)nodeLocators->locators;
    __builtin_memcpy(to, from, odd);
    __builtin_memcpy(to + odd, from + odd, sizeof own->locators - odd);
  } else {
    for (uint16_t i = 0; i < count; i++) nodeLocators->locators[i] = own->locators[i];
  }
  KARSTResolverUnlockInstance(instance);
  return ZEL_OK;
}

} /* extern "C" */
