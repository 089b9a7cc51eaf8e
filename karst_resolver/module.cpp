/* Loading and unloading: the module's globals, its heap, and init_module and cleanup_module. Runs
 * on the loader's thread. What the module declares to the loader is in declaration.cpp. */
#include "karst_resolver/cache.h"
#include "karst_resolver/declaration.h"
#include "karst_resolver/log.h"
#include "karst_resolver/model.h"
#include "karst_resolver/trace.h"
#include "platform/qxt.h"
#include "platform/tolm.h"

extern "C" {

zel_ModuleID karstResolverModuleID = ZEL_NO_MODULE;
zel_Log *karstResolverLogHandle;
KARSTResolverCache *karstResolverCache;

/* In log lines, the loading half names itself so. */
#define LOAD_FUNCTION "KARSTResolverInit"

/* Room for one instance and its spinlock for each of the transport's associations, and 5 MiB; never
 * less than the parameter. In 32-bit arithmetic: sums and products wrap. */
static uint32_t KARSTResolverMaxHeapSize(void) {
  const uint32_t base = 0x500000;
  uint32_t perAssociation = tolmapi_HeapRequest2Size(sizeof(KARSTResolverInstance)) +
                            zel_SpinlockAllocSize(ZEL_SPINLOCK_RANKED);
  uint32_t computed = QXT_GetMaxAssocCount() * perAssociation + base;
  uint32_t least = (uint32_t)KARST_RESOLVER_LEAST_MAX_HEAP;
  return computed >= least ? computed : least;
}

static zel_Status KARSTResolverCreateHeap(void) {
  zel_HeapProps props;
  props.type = 0;
  zel_NameInitialize(&props.name, "KARSTResolver");
  props.moduleID = karstResolverModuleID;
  props.initialSize = 0x40000;
  props.maximumSize = KARSTResolverMaxHeapSize();
  props.reserved = 0;
  zel_Status status = zel_HeapCreate(&props, &karstResolverHeapID);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT_AS(LOAD_FUNCTION, "Failed to create heap: %s\n",
                             zel_StatusToString(status));
  }
  return status;
}

static zel_Status KARSTResolverCreateLockDomain(void) {
  zel_Name name;
  zel_NameInitialize(&name, "KARSTResolver");
  zel_Status status = zel_LockDomainCreate(karstResolverModuleID, karstResolverHeapID, &name,
                                           &karstResolverLockDomain);
  if (status != ZEL_OK) {
    KARST_RESOLVER_REPORT_AS(LOAD_FUNCTION, "Failed to create lock domain: %s\n",
                             zel_StatusToString(status));
  }
  return status;
}

/* Takes down whatever loading has built, in the reverse order: the cache's lock is the domain's
 * last one, most of the heap is the cache's, and it may still log. */
static void KARSTResolverCleanup(void) {
  if (karstResolverCache != nullptr) {
    KARSTResolverCacheCleanup(karstResolverCache);
    karstResolverCache = nullptr;
  }
  if (karstResolverLockDomain != ZEL_NO_LOCK_DOMAIN) {
    zel_LockDomainDestroy(karstResolverLockDomain);
    karstResolverLockDomain = ZEL_NO_LOCK_DOMAIN;
  }
  if (karstResolverHeapID != ZEL_NO_HEAP) {
    zel_HeapDestroy(karstResolverHeapID);
    karstResolverHeapID = ZEL_NO_HEAP;
  }
  if (karstResolverLogHandle != nullptr) Tolm_LogCleanup(&karstResolverLogHandle);
  karstResolverModuleID = ZEL_NO_MODULE;
}

__attribute__((visibility("default"))) int init_module(void) {
  karstResolverModuleID = zel_ModuleCurrentID;
  KARSTResolverTraceInit();
  /* The cache comes last: from its creation on, directory threads may enter the module. */
  if (Tolm_LogInit("KARSTResolver", karstResolverModuleID, 2, 0, &karstResolverLogHandle) ==
          ZEL_OK &&
      KARSTResolverCreateHeap() == ZEL_OK && KARSTResolverCreateLockDomain() == ZEL_OK &&
      KARSTResolverCacheInit(&karstResolverCache) == ZEL_OK) {
    return 0;
  }
  KARSTResolverCleanup();
  return -1;
}

__attribute__((visibility("default"))) void cleanup_module(void) {
  KARSTResolverCleanup();
}

} /* extern "C" */
