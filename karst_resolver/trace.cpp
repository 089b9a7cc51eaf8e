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

/* What goes into one record. */
struct KARSTResolverTraceContent {
  uint32_t type;
  uint32_t id;
  uint32_t siteNumber;
  const uint64_t *payload;
};

/* A masked update of some bits of a word. The record is in a ring that readers read at the same
 * time: every store is a whole word, in the order written here. */
static void KARSTResolverTraceSetBits(uint64_t *word, uint32_t shift, uint32_t width,
                                      uint64_t value) {
  uint64_t mask = ((1ull << width) - 1) << shift;
  uint64_t old = __atomic_load_n(word, __ATOMIC_RELAXED);
  __atomic_store_n(word, (old & ~mask) | ((value << shift) & mask), __ATOMIC_RELAXED);
}

static void KARSTResolverTraceWrite(TraceStream *stream, const KARSTResolverTraceContent *content) {
  uint64_t sequence = __atomic_fetch_add(&stream->sequence, 1, __ATOMIC_RELAXED);
  TraceRecord *ring = (TraceRecord *)((uint8_t *)stream + TRACE_STREAM_RING);
  TraceRecord *record = &ring[sequence & stream->mask];

  uint64_t processor = tolmapi_GetPCPUNumPreemptible();
  uint64_t nanoseconds = zel_TimerTCToNS(zel_GetTimerCycles());

  KARSTResolverTraceSetBits(&record->word1, 35, 29, sequence);
  KARSTResolverTraceSetBits(&record->word0, 1, 8, processor);
  KARSTResolverTraceSetBits(&record->word1, 0, 6, content->type);
  KARSTResolverTraceSetBits(&record->word1, 6, 14, content->id);
  KARSTResolverTraceSetBits(&record->word1, 20, 15, content->siteNumber);
  KARSTResolverTraceSetBits(&record->word0, 9, 55, nanoseconds);
  for (int i = 0; i < 6; i++) {
    __atomic_store_n(&record->payload[i], content->payload[i], __ATOMIC_RELAXED);
  }

  /* Last, and released: a reader that sees this lap's phase sees the whole record. */
  uint64_t phase = ~(sequence >> stream->lapShift) & 1;
  uint64_t word0 = __atomic_load_n(&record->word0, __ATOMIC_RELAXED);
  __atomic_store_n(&record->word0, (word0 & ~1ull) | phase, __ATOMIC_RELEASE);

  uint64_t notifyHandle = __atomic_load_n(&stream->notifyHandle, __ATOMIC_RELAXED);
  if (notifyHandle == 0) return;
  if (sequence % TRACE_WALL_CLOCK_EVERY == 0) Trace_CreateWallClockEntry(stream, record);
  if (sequence % TRACE_NOTIFY_EVERY == 0) Trace_Notify(notifyHandle);
}

void KARSTResolverTraceEmit(TokenBucketMini *bucket, uint32_t id, uint32_t siteNumber,
                            const uint64_t payload[6]) {
  TraceStream *stream = (TraceStream *)traceStreamTables[1];
  if (!(__atomic_load_n(&stream->flags, __ATOMIC_RELAXED) & TRACE_STREAM_ENABLED)) return;

  KARSTResolverTraceContent content = {TRACE_RECORD_EVENT, id, siteNumber, payload};
  uint64_t notice[6] = {};
  if (__atomic_load_n(&stream->throttling, __ATOMIC_RELAXED)) {
    uint64_t left;
    if (!TokenBucket_UseTokensMini(bucket, perTraceTbConfig, 1, &left)) return;
    if (left == 0) { /* this event's last token: say that it is being suppressed */
      notice[0] = TokenBucket_TimeToGetTokens(bucket);
      notice[1] = (uint64_t)id << 6 | TRACE_RECORD_EVENT;
      content = {TRACE_RECORD_THROTTLE, Trace_GetPerTraceThrottledTraceId(), SITE_PER_EVENT_NOTICE,
                 notice};
    }
    if (!TokenBucket_UseTokens(&stream->globalBucket, 1, &left)) return;
    if (left == 0) { /* the stream's last: that matters more than any one event */
      notice[0] = TokenBucket_TimeToGetTokens(&stream->globalBucket);
      notice[1] = 0;
      content = {TRACE_RECORD_THROTTLE, Trace_GetGlobalThrottledTraceId(), SITE_GLOBAL_NOTICE,
                 notice};
    }
  }
  KARSTResolverTraceWrite(stream, &content);
}

} /* extern "C" */
