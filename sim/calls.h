/* The platform's functions as the simulator knows them: names, what a caller may hold, how they
 * fail. Constant tables, no lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>

#include "platform/expr_msh.h"
#include "platform/zel.h"

namespace sim {

/* X(function, where, fault)
 *   where: Anywhere, or Unlocked for a function that must not be called with a spinlock held
 *   fault: the status that an injected failure returns unless another is asked for; ZEL_OK for a
 *          function that cannot fail */
#define SIM_PLATFORM_CALLS(X)                                  \
  X(zel_StatusToString, Anywhere, ZEL_OK)                      \
  X(zel_NameInitialize, Anywhere, ZEL_OK)                      \
  X(zel_Snprintf, Anywhere, ZEL_OK)                            \
  X(zel_HeapCreate, Unlocked, ZEL_NO_MEMORY)                   \
  X(zel_HeapDestroy, Unlocked, ZEL_OK)                         \
  X(zel_HeapAllocWithRA, Anywhere, ZEL_NO_MEMORY)              \
  X(zel_HeapFree, Anywhere, ZEL_OK)                            \
  X(zel_LockDomainCreate, Unlocked, ZEL_NO_MEMORY)             \
  X(zel_LockDomainDestroy, Unlocked, ZEL_OK)                   \
  X(zel_SpinlockAllocSize, Anywhere, ZEL_OK)                   \
  X(zel_SpinlockCreate, Anywhere, ZEL_NO_MEMORY)               \
  X(zel_SpinlockDestroy, Anywhere, ZEL_OK)                     \
  X(zel_SpinlockLock, Anywhere, ZEL_OK)                        \
  X(zel_SpinlockUnlock, Anywhere, ZEL_OK)                      \
  X(zel_LogLevel, Anywhere, ZEL_OK)                            \
  X(zel_LogNoLevel, Anywhere, ZEL_OK)                          \
  X(zel_LogGetName, Anywhere, ZEL_OK)                          \
  X(zel_LogGetCurrentLogLevel, Anywhere, ZEL_OK)               \
  X(zel_WorldWait, Unlocked, ZEL_OK)                           \
  X(zel_WorldForceWakeup, Anywhere, ZEL_OK)                    \
  X(zel_WorldSleep, Unlocked, ZEL_OK)                          \
  X(zel_GetTimerCycles, Anywhere, ZEL_OK)                      \
  X(zel_TimerTCToNS, Anywhere, ZEL_OK)                         \
  X(zel_PanicWithModuleID, Anywhere, ZEL_OK)                   \
  X(Tolm_LogInit, Unlocked, ZEL_NO_MEMORY)                     \
  X(Tolm_LogCleanup, Unlocked, ZEL_OK)                         \
  X(TOLM_WorldCreate, Unlocked, ZEL_NO_MEMORY)                 \
  X(TOLM_WorldDestroy, Unlocked, ZEL_OK)                       \
  X(TOLM_IsWitnessNode, Anywhere, ZEL_OK)                      \
  X(tolmapi_HeapRequest2Size, Anywhere, ZEL_OK)                \
  X(tolmapi_PreemptionEnable, Unlocked, ZEL_OK)                \
  X(tolmapi_PreemptionIsPending, Anywhere, ZEL_OK)             \
  X(tolmapi_GetPCPUNumPreemptible, Anywhere, ZEL_OK)           \
  X(tolmapi_GetReturnAddress, Anywhere, ZEL_OK)                \
  X(QXT_GetMaxAssocCount, Anywhere, ZEL_OK)                    \
  X(KARST_RegisterStatusCallback, Unlocked, ZEL_NO_MEMORY)     \
  X(KARST_DeregisterStatusCallback, Unlocked, ZEL_OK)          \
  X(KARST_GetSelfUUID, Anywhere, ZEL_OK)                       \
  X(KARST_Subscribe, Anywhere, ZEL_NO_MEMORY)                  \
  X(KARST_Unsubscribe, Anywhere, ZEL_OK)                       \
  X(KARST_FindEntry, Anywhere, ZEL_FAILURE)                    \
  X(KARST_FindFullEntryByQuery, Anywhere, ZEL_NO_MEMORY)       \
  X(KARST_FindFullEntryByHeader, Anywhere, ZEL_NO_MEMORY)      \
  X(ExprMsh_UmshSingleStructure, Anywhere, EXPR_MSH_MALFORMED) \
  X(Trace_ClassLevelGet, Anywhere, ZEL_OK)                     \
  X(Trace_GetPerTraceThrottledTraceId, Anywhere, ZEL_OK)       \
  X(Trace_GetGlobalThrottledTraceId, Anywhere, ZEL_OK)         \
  X(Trace_CreateWallClockEntry, Anywhere, ZEL_OK)              \
  X(Trace_Notify, Anywhere, ZEL_OK)                            \
  X(TokenBucket_InitMini, Anywhere, ZEL_OK)                    \
  X(TokenBucket_UseTokensMini, Anywhere, ZEL_OK)               \
  X(TokenBucket_UseTokens, Anywhere, ZEL_OK)                   \
  X(TokenBucket_TimeToGetTokens, Anywhere, ZEL_OK)

enum class Call : uint8_t {
#define SIM_ENUMERATOR(function, where, fault) function,
  SIM_PLATFORM_CALLS(SIM_ENUMERATOR)
#undef SIM_ENUMERATOR
};

enum class Where : uint8_t { Anywhere, Unlocked };

struct CallTraits {
  const char *name;
  Where where;
  zel_Status fault;
};

inline constexpr CallTraits callTraits[] = {
#define SIM_TRAITS(function, where, fault) {#function, Where::where, fault},
    SIM_PLATFORM_CALLS(SIM_TRAITS)
#undef SIM_TRAITS
};
inline constexpr size_t callCount = sizeof callTraits / sizeof callTraits[0];

constexpr const CallTraits &traits(Call call) {
  return callTraits[static_cast<size_t>(call)];
}

}  // namespace sim
