/* A client of the KARST resolver: a kernel module that asks where this host's own node can be
 * reached and logs the answer whenever it is computed anew.
 *
 * Build it as a shared object without libraries (-shared -fPIC -nostdlib -fvisibility=hidden) and
 * load it after the resolver. One world of its own reads the answers: the resolver's callback runs
 * under the instance's lock, where reading is not allowed, so it only wakes that world.
 */
#include "karst_resolver/karst_resolver.h"
#include "platform/karst_directory.h"
#include "platform/tolm.h"
#include "platform/zel.h"

#define DECLARE(section_name) __attribute__((section(section_name), used))
#define ENTRY __attribute__((visibility("default")))

/* ---- What the loader reads ------------------------------------------------------------------- */

#define NS_RESOLVER "com.tarvik.karst.resolver#0.0.0.1"
#define NS_KARST "com.tarvik.karst#0.0.0.1"
#define NS_TOLMUTIL "com.tarvik.tolmutil#0.0.0.1"
#define NS_ZELAPI "com.tarvik.zelapi#v2_4_0_0"

/* Strings back to back, each with its NUL; the last one's is the literal's own. */
DECLARE(".karst.modinfo")
static const char moduleInfo[] =
    "param_CLIENT_USE_LOCAL_LOCATOR:int\0"
    "param_desc_CLIENT_USE_LOCAL_LOCATOR=1: answer \"local\" for this host itself (default: 1)\0"
    "nsRequired=" NS_RESOLVER
    "\0"
    "nsRequired=" NS_KARST
    "\0"
    "nsRequired=" NS_TOLMUTIL
    "\0"
    "nsRequired=" NS_ZELAPI;

DECLARE(".karst.required")
static const char requiredNamespaces[] = NS_RESOLVER "\0" NS_KARST "\0" NS_TOLMUTIL "\0" NS_ZELAPI;

/* The loader writes the variable before it calls init_module. */
static int32_t useLocalLocator = 1;

struct ParameterRecord {
  const char *name;
  uint64_t type; /* 1: 32-bit int */
  void *variable;
  uint64_t reserved[2];
};

DECLARE(".karst.params")
static const struct ParameterRecord parameters[] = {
    {"CLIENT_USE_LOCAL_LOCATOR", 1, &useLocalLocator, {0, 0}},
};

/* ---- What the module does -------------------------------------------------------------------- */

static zel_HeapID heap = ZEL_NO_HEAP;
static zel_WorldID reader = ZEL_NO_WORLD;
static KARSTResolverInstance *instance = NULL;

/* On the resolver's thread, a directory thread or our own: note it, wake the reader, return. */
static void addressesChanged(void *data, KARSTResolverInstance *changed, uint32_t state) {
  (void)data;
  (void)changed;
  zel_LogNoLevel(ZEL_LOG_URGENCY_INFO, "client: this host's node is %s\n",
                 state == KARST_RESOLVER_STATE_RESOLVED ? "resolved" : "unresolved");
  zel_WorldForceWakeup(__atomic_load_n(&reader, __ATOMIC_ACQUIRE));
}

static void logLocators(void) {
  KARSTResolverNodeLocators locators = {.capacity = KARST_RESOLVER_MAX_LOCATORS};
  const zel_Status status = KARSTResolver_GetNodeLocators(instance, &locators);
  if (status != ZEL_OK) {
    zel_LogNoLevel(ZEL_LOG_URGENCY_INFO, "client: no locators: %s\n", zel_StatusToString(status));
    return;
  }
  zel_LogNoLevel(ZEL_LOG_URGENCY_INFO, "client: %u locators, the first of type %u\n",
                 (unsigned)locators.count,
                 locators.count == 0 ? 0u : (unsigned)locators.locators[0].networkType);
}

/* A wake-up that comes while we read is kept for the next wait: no answer is missed. */
static uint32_t readerBody(void *data) {
  (void)data;
  while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "client: addresses") == ZEL_OK) {
    logLocators();
  }
  return 0;
}

static zel_Status createHeap(void) {
  zel_HeapProps props = {
      .moduleID = zel_ModuleCurrentID, .initialSize = 4096, .maximumSize = 65536};
  zel_NameInitialize(&props.name, "client");
  return zel_HeapCreate(&props, &heap);
}

static zel_Status start(void) {
  const zel_UUID noObject = {{0}};
  zel_UUID self;
  KARST_GetSelfUUID(&self);

  zel_Status status = createHeap();
  if (status != ZEL_OK) return status;
  status = KARSTResolver_Create(&instance, 0, noObject, self, useLocalLocator != 0);
  if (status != ZEL_OK) return status;
  status = TOLM_WorldCreate(&reader, "client", zel_ModuleCurrentID, readerBody, NULL, 1, heap);
  if (status != ZEL_OK) return status;
  KARSTResolver_SetCallback(instance, addressesChanged, NULL);
  return ZEL_OK;
}

/* Undoes whatever of start() was done. No callback runs after the callback is removed, so that the
 * reader ends first and the instance that it reads from after it. */
ENTRY void cleanup_module(void) {
  if (instance != NULL) KARSTResolver_SetCallback(instance, NULL, NULL);
  TOLM_WorldDestroy(&reader);
  if (instance != NULL) KARSTResolver_Destroy(instance);
  instance = NULL;
  if (heap != ZEL_NO_HEAP) zel_HeapDestroy(heap);
  heap = ZEL_NO_HEAP;
}

ENTRY int init_module(void) {
  const zel_Status status = start();
  if (status == ZEL_OK) return 0;
  zel_LogNoLevel(ZEL_LOG_URGENCY_WARNING, "client: cannot start: %s\n", zel_StatusToString(status));
  cleanup_module();
  return -1;
}
