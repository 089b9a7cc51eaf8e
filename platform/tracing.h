/* The tracing library: streams of 64-byte records, class levels and token buckets.
 *
 * Every function here may be called from any thread and with a spinlock held, and none blocks.
 */
#ifndef PLATFORM_TRACING_H
#define PLATFORM_TRACING_H

#include "platform/zel.h"

#ifdef __cplusplus
extern "C" {
#endif

#define TRACE_RECORD_EVENT 8u    /* type of an event's record */
#define TRACE_RECORD_THROTTLE 9u /* type of a throttle notice's record */

/* A record.
 *   word0: bit 0 phase, bits 1-8 processor, bits 9-63 time stamp (ns)
 *   word1: bits 0-5 type, bits 6-19 trace id, bits 20-34 site number, bits 35-63 sequence number */
typedef struct TraceRecord {
  uint64_t word0;
  uint64_t word1;
  uint64_t payload[6];
} TraceRecord;
ZEL_STATIC_ASSERT(sizeof(TraceRecord) == 64, "layout of a record");

/* A full token bucket, the library's own: a stream has one. */
typedef struct TokenBucket {
  uint64_t opaque[5];
} TokenBucket;

/* A small one that shares its configuration with others. All zero before TokenBucket_InitMini. */
typedef struct TokenBucketMini {
  uint64_t opaque[2];
} TokenBucketMini;
ZEL_STATIC_ASSERT(sizeof(TokenBucketMini) == 16, "layout of a small bucket");

/* A stream and its ring of mask + 1 records. Record s (its sequence number) goes to slot s AND
 * mask; its phase bit is the inverse of the bit of s at lapShift, so that a reader tells a finished
 * record of this lap from one of the lap before. */
typedef struct TraceStream {
  uint64_t sequence; /* fetched and incremented atomically, once a record */
  uint64_t library0; /* the library's own */
  TokenBucket globalBucket;
  uint8_t throttling; /* non-zero: emitters ask the buckets */
  uint8_t library1[15];
  uint64_t mask;
  uint16_t library2;
  uint16_t lapShift;
  uint8_t library3;
  uint8_t flags; /* TRACE_STREAM_ENABLED */
  uint8_t library4[10];
  uint64_t notifyHandle; /* zero: no wall-clock entries, no notification */
  uint8_t library5[24];
} TraceStream; /* the ring follows, at TRACE_STREAM_RING */
ZEL_STATIC_ASSERT(offsetof(TraceStream, globalBucket) == 16, "layout of a stream");
ZEL_STATIC_ASSERT(offsetof(TraceStream, throttling) == 56, "layout of a stream");
ZEL_STATIC_ASSERT(offsetof(TraceStream, mask) == 72, "layout of a stream");
ZEL_STATIC_ASSERT(offsetof(TraceStream, lapShift) == 82, "layout of a stream");
ZEL_STATIC_ASSERT(offsetof(TraceStream, flags) == 85, "layout of a stream");
ZEL_STATIC_ASSERT(offsetof(TraceStream, notifyHandle) == 96, "layout of a stream");
ZEL_STATIC_ASSERT(sizeof(TraceStream) == 128, "the ring follows at 128");

#define TRACE_STREAM_ENABLED 0x1u
#define TRACE_STREAM_RING 128u       /* offset of slot 0 */
#define TRACE_WALL_CLOCK_EVERY 2048u /* records between two wall-clock entries */
#define TRACE_NOTIFY_EVERY 512u      /* records between two notifications */

/* The streams; modules of this product write to element 1. */
extern void *traceStreamTables[];

/* The configuration that all small buckets share; opaque, its address is passed. */
extern const unsigned char perTraceTbConfig[];

/* Current level of a trace class: an event of level L is written when it is at least L. */
int32_t Trace_ClassLevelGet(uint32_t traceClass);

/* Fills a small bucket. */
void TokenBucket_InitMini(TokenBucketMini *bucket, const void *config);

/* Takes tokens. True when they were granted. *out, set in both cases, is the number of tokens left
 * after that; an emitter whose grant leaves 0 writes a throttle notice instead of its event. */
bool TokenBucket_UseTokensMini(TokenBucketMini *bucket, const void *config, uint64_t tokens,
                               uint64_t *out);
bool TokenBucket_UseTokens(TokenBucket *bucket, uint64_t tokens, uint64_t *out);

/* Time until the bucket has a token again, in nanoseconds; 0 when it has one, all ones when it never
 * will. Serves both kinds; a small bucket is told from a full one by its address. */
uint64_t TokenBucket_TimeToGetTokens(void *bucket);

/* Trace ids of the two kinds of throttle notice. */
uint32_t Trace_GetPerTraceThrottledTraceId(void);
uint32_t Trace_GetGlobalThrottledTraceId(void);

/* Ties the time stamp of the record just written to the wall clock. */
void Trace_CreateWallClockEntry(void *stream, TraceRecord *record);

/* Tells the stream's reader that there is something to read. */
void Trace_Notify(uint64_t handle);

#ifdef __cplusplus
}
#endif

#endif
