/* The module's binary trace events: the catalogue and the emission. No lock: a record is claimed by
 * one atomic increment, and its phase bit, written last, tells a reader that it is complete.
 *
 * An event that is not selected costs one call and one comparison; its payload is not even read.
 */
#ifndef KARST_RESOLVER_TRACE_H
#define KARST_RESOLVER_TRACE_H

#include "platform/tracing.h"

/* Event, id, class (35 network interfaces, 36 nodes, 37 instances), lowest class level that selects
 * it. In the order in which the token buckets are initialised. */
#define KARST_RESOLVER_TRACE_EVENTS(X) \
  X(CreateInstance, 1, 37, 2)          \
  X(DestroyInstance, 2, 37, 2)         \
  X(TrackNode, 3, 37, 2)               \
  X(ObjectUpdated, 4, 37, 2)           \
  X(ObjectDisappeared, 5, 37, 2)       \
  X(UpdateAddresses, 6, 37, 2)         \
  X(InvokeCallback, 7, 37, 2)          \
  X(AddNetIfToCache, 8, 35, 2)         \
  X(RemoveNetIfFromCache, 9, 35, 2)    \
  X(UpdateNetIfInfo, 10, 35, 2)        \
  X(UpdateNetIfHealth, 11, 35, 2)      \
  X(AddNodeToCache, 12, 36, 2)         \
  X(RemoveNodeFromCache, 13, 37, 0)    \
  X(UpdateNodeReachability, 14, 36, 2) \
  X(RescanNetIfs, 15, 35, 2)           \
  X(RescanNodes, 16, 36, 2)            \
  X(SetCallback, 17, 37, 2)            \
  X(ReleaseInstance, 18, 37, 2)        \
  X(TransientErrorInjection, 19, 37, 2)

extern "C" {

#define KARST_RESOLVER_TRACE_DECLARE(event, id, traceClass, level) \
  extern TokenBucketMini KARSTResolverTrace##event##Tb;
KARST_RESOLVER_TRACE_EVENTS(KARST_RESOLVER_TRACE_DECLARE)
#undef KARST_RESOLVER_TRACE_DECLARE

/* Fills the buckets, in order. Once, before anything is emitted. */
void KARSTResolverTraceInit(void);

/* Steps from the stream on: throttles and writes at most one record. `kind` is what its word 1 holds
 * besides the sequence number. */
void KARSTResolverTraceEmit(TokenBucketMini *bucket, uint64_t kind, const uint64_t payload[6]);

} /* extern "C" */

#define KARST_RESOLVER_TRACE_CONSTANTS(event, id, traceClass, level) \
  enum {                                                             \
    KARST_RESOLVER_TRACE_ID_##event = id,                            \
    KARST_RESOLVER_TRACE_CLASS_##event = traceClass,                 \
    KARST_RESOLVER_TRACE_LEVEL_##event = level,                      \
  };
KARST_RESOLVER_TRACE_EVENTS(KARST_RESOLVER_TRACE_CONSTANTS)
#undef KARST_RESOLVER_TRACE_CONSTANTS

/* Type, trace id and site number of a record. */
#define KARST_RESOLVER_TRACE_KIND(type, id, siteNumber) \
  ((type) | (uint64_t)((id)&0x3fff) << 6 | (uint64_t)((siteNumber)&0x7fff) << 20)

/* Emits an event from the trace statement `siteNumber`; up to six 64-bit payload words, the rest is
 * zero. */
#define KARST_RESOLVER_TRACE(event, siteNumber, ...)                                               \
  do {                                                                                             \
    if (__builtin_expect(Trace_ClassLevelGet(KARST_RESOLVER_TRACE_CLASS_##event) >=                \
                             KARST_RESOLVER_TRACE_LEVEL_##event,                                   \
                         0)) {                                                                     \
      const uint64_t tracePayload[6] = {__VA_ARGS__};                                              \
      KARSTResolverTraceEmit(&KARSTResolverTrace##event##Tb,                                       \
                             KARST_RESOLVER_TRACE_KIND(                                            \
                                 TRACE_RECORD_EVENT, KARST_RESOLVER_TRACE_ID_##event, siteNumber), \
                             tracePayload);                                                        \
    }                                                                                              \
  } while (0)

/* A flag as a payload word: a u8, sign-extended. */
#define KARST_RESOLVER_TRACE_FLAG(flag) ((uint64_t)(int64_t)(int8_t)(flag))
#define KARST_RESOLVER_TRACE_POINTER(pointer) ((uint64_t)(pointer))
/* Two words. */
#define KARST_RESOLVER_TRACE_UUID(uuid) KARSTResolverUUIDLow(uuid), KARSTResolverUUIDHigh(uuid)

#endif
