/* What the module declares to the loader, each table in a section of its own. */
#include "karst_resolver/declaration.h"

#include "karst_resolver/karst_resolver.h"

extern "C" {

int32_t KARST_RESOLVER_LEAST_MAX_HEAP = 0xa00000;

#define SECTION(name) __attribute__((section(name), used))

#define NS_TRACING "com.tarvik.tracing#0.0.0.1"
#define NS_QXT "com.tarvik.qxt#0.0.0.1"
#define NS_TOLMUTIL "com.tarvik.tolmutil#0.0.0.1"
#define NS_KARST "com.tarvik.karst#0.0.0.1"
#define NS_TOLMAPI "com.tarvik.tolmapi#0.0.0.2"
#define NS_ZELAPI "com.tarvik.zelapi#v2_4_0_0"
#define NS_ZELAPI_INCOMPAT "com.tarvik.zelapi.incompat#v2_4_0_0"

/* Strings back to back, each with its NUL: the last one's is the literal's own. */
SECTION(".karst.modinfo")
static const char karstResolverModuleInfo[] =
    "param_KARST_RESOLVER_LEAST_MAX_HEAP:int\0"
    "nsRequired=" NS_TRACING
    "\0"
    "nsRequired=" NS_QXT
    "\0"
    "nsRequired=" NS_TOLMUTIL
    "\0"
    "nsRequired=" NS_KARST
    "\0"
    "nsProvides=com.tarvik.karst.resolver#0.0.0.1\0"
    "param_desc_KARST_RESOLVER_LEAST_MAX_HEAP=Min heap size in bytes (default: 10MB)\0"
    "nsRequired=" NS_TOLMAPI
    "\0"
    "nsRequired=" NS_ZELAPI
    "\0"
    "nsRequired=" NS_ZELAPI_INCOMPAT;

SECTION(".karst.required")
static const char karstResolverRequiredNamespaces[] =
    NS_TRACING "\0" NS_QXT "\0" NS_TOLMUTIL "\0" NS_KARST "\0" NS_TOLMAPI "\0" NS_ZELAPI
               "\0" NS_ZELAPI_INCOMPAT;

struct KARSTModuleParameter {
  const char *name;
  uint64_t type; /* 1: 32-bit int */
  void *variable;
  uint64_t reserved[2];
};
static_assert(sizeof(KARSTModuleParameter) == 40, "layout of a parameter record");

SECTION(".karst.params")
static const KARSTModuleParameter karstResolverParameters[] = {
    {"KARST_RESOLVER_LEAST_MAX_HEAP", 1, &KARST_RESOLVER_LEAST_MAX_HEAP, {0, 0}},
};

struct KARSTModuleExport {
  const char *name;
  uint64_t reserved;
};
static_assert(sizeof(KARSTModuleExport) == 16, "layout of an exported-symbol record");

SECTION(".karst.exports")
static const KARSTModuleExport karstResolverExports[] = {
    {"KARSTResolver_GetNodeLocators", 0},
    {"KARSTResolver_SetCallback", 0},
    {"KARSTResolver_Destroy", 0},
    {"KARSTResolver_Create", 0},
};

} /* extern "C" */
