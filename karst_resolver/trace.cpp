/* Emission of trace events; see trace.h. No lock. */
#include "karst_resolver/trace.h"

#include "platform/tolm.h"

extern "C" {

#define KARST_RESOLVER_TRACE_DEFINE(event, id, traceClass, level) \
  TokenBucketMini KARSTResolverTrace##event##Tb;
KARST_RESOLVER_TRACE_EVENTS(KARST_RESOLVER_TRACE_DEFINE)
#undef KARST_RESOLVER_TRACE_DEFINE

void KARSTResolverTraceInit(void) {
#define KARST_RESOLVER_TRACE_INIT(event, id, traceClass, level) \
  TokenBucket_InitMini(&KARSTResolverTrace##event##Tb, perTraceTbConfig);
  KARST_RESOLVER_TRACE_EVENTS(KARST_RESOLVER_TRACE_INIT)
#undef KARST_RESOLVER_TRACE_INIT
}

/* Site numbers of the two throttle notices. */
enum { SITE_PER_EVENT_NOTICE = 407, SITE_GLOBAL_NOTICE = 430 };

/* A masked update of some bits of a word of the record, which readers read at the same time: every
 * store is a whole word, and they are made in the order written here. Nobody else writes the record
 * in this lap, so that a word's other bits are those that were stored or found last. */
static void KARSTResolverTraceSetBits(uint64_t *word, uint64_t *known, uint32_t shift,
                                      uint32_t width, uint64_t value) {
  uint64_t mask = ((1ull << width) - 1) << shift;
  *known = (*known & ~mask) | ((value << shift) & mask);
  __atomic_store_n(word, *known, __ATOMIC_RELAXED);
}

/* A function of its own, as are the two below: what they save of their caller's registers, an event
 * that goes less far is not to pay for. */
static __attribute__((noinline)) void KARSTResolverTraceWrite(TraceStream *stream, uint64_t kind,
                                                              const uint64_t payload[6]) {
  uint64_t sequence = __atomic_fetch_add(&stream->sequence, 1, __ATOMIC_RELAXED);
  TraceRecord *ring = (TraceRecord *)((uint8_t *)stream + TRACE_STREAM_RING);
  TraceRecord *record = &ring[sequence & stream->mask];
  __builtin_prefetch(record, 1); /* a lap old: on its way while the clock is read */

  uint64_t processor = tolmapi_GetPCPUNumPreemptible();
  uint64_t nanoseconds = zel_TimerTCToNS(zel_GetTimerCycles());

  uint64_t word0 = __atomic_load_n(&record->word0, __ATOMIC_RELAXED);
  uint64_t word1 = __atomic_load_n(&record->word1, __ATOMIC_RELAXED);
  KARSTResolverTraceSetBits(&record->word1, &word1, 35, 29, sequence);
  KARSTResolverTraceSetBits(&record->word0, &word0, 1, 8, processor);
  KARSTResolverTraceSetBits(&record->word1, &word1, 0, 6, kind); /* type, id and site number */
  KARSTResolverTraceSetBits(&record->word1, &word1, 6, 14, kind >> 6);
  KARSTResolverTraceSetBits(&record->word1, &word1, 20, 15, kind >> 20);
  KARSTResolverTraceSetBits(&record->word0, &word0, 9, 55, nanoseconds);
  __atomic_store_n(&record->payload[0], payload[0], __ATOMIC_RELAXED);
  __atomic_store_n(&record->payload[1], payload[1], __ATOMIC_RELAXED);
  __atomic_store_n(&record->payload[2], payload[2], __ATOMIC_RELAXED);
  __atomic_store_n(&record->payload[3], payload[3], __ATOMIC_RELAXED);
  __atomic_store_n(&record->payload[4], payload[4], __ATOMIC_RELAXED);
  __atomic_store_n(&record->payload[5], payload[5], __ATOMIC_RELAXED);

  /* Last, and released: a reader that sees this lap's phase sees the whole record. */
  uint64_t phase = ~(sequence >> stream->lapShift) & 1;
  __atomic_store_n(&record->word0, (word0 & ~1ull) | phase, __ATOMIC_RELEASE);

  uint64_t notifyHandle = __atomic_load_n(&stream->notifyHandle, __ATOMIC_RELAXED);
  if (notifyHandle == 0) return;
  if (sequence % TRACE_WALL_CLOCK_EVERY == 0) Trace_CreateWallClockEntry(stream, record);
  if (sequence % TRACE_NOTIFY_EVERY == 0) Trace_Notify(notifyHandle);
}

static uint64_t KARSTResolverTraceNoticeKind(uint32_t id, uint32_t siteNumber) {
  return KARST_RESOLVER_TRACE_KIND(TRACE_RECORD_THROTTLE, id, siteNumber);
}

/* An event that its own bucket lets through, and `left` more: now the stream's is asked. A bucket's last
 * token is for a notice in the event's place. */
static __attribute__((noinline)) void KARSTResolverTraceEmitGranted(TokenBucketMini *bucket,
                                                                    uint64_t kind,
                                                                    const uint64_t payload[6],
                                                                    TraceStream *stream,
                                                                    uint64_t left) {
  uint64_t notice[6] = {};
  if (left == 0) { /* say that this event is being suppressed */
    notice[0] = TokenBucket_TimeToGetTokens(bucket);
    notice[1] = kind & 0xfffff; /* its type and id */
    kind = KARSTResolverTraceNoticeKind(Trace_GetPerTraceThrottledTraceId(), SITE_PER_EVENT_NOTICE);
    payload = notice;
  }
  if (!TokenBucket_UseTokens(&stream->globalBucket, 1, &left)) return;
  if (left == 0) { /* the whole stream is: that matters more than any one event */
    notice[0] = TokenBucket_TimeToGetTokens(&stream->globalBucket);
    notice[1] = 0;
    kind = KARSTResolverTraceNoticeKind(Trace_GetGlobalThrottledTraceId(), SITE_GLOBAL_NOTICE);
    payload = notice;
  }
  KARSTResolverTraceWrite(stream, kind, payload);
}

/* In a flood nearly every event ends here. */
static __attribute__((noinline)) void KARSTResolverTraceEmitThrottled(TokenBucketMini *bucket,
                                                                      uint64_t kind,
                                                                      const uint64_t payload[6],
                                                                      TraceStream *stream) {
  uint64_t left;
  if (TokenBucket_UseTokensMini(bucket, perTraceTbConfig, 1, &left)) {
    KARSTResolverTraceEmitGranted(bucket, kind, payload, stream, left);
  }
}

void KARSTResolverTraceEmit(TokenBucketMini *bucket, uint64_t kind, const uint64_t payload[6]) {
  TraceStream *stream = (TraceStream *)traceStreamTables[1];
  if (!(__atomic_load_n(&stream->flags, __ATOMIC_RELAXED) & TRACE_STREAM_ENABLED)) return;
  if (__atomic_load_n(&stream->throttling, __ATOMIC_RELAXED)) {
    KARSTResolverTraceEmitThrottled(bucket, kind, payload, stream);
  } else {
    KARSTResolverTraceWrite(stream, kind, payload);
  }
}

} /* extern "C" */
