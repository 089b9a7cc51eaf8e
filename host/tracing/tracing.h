/* The tracing library: streams, class levels, token buckets; behind the Trace_ and TokenBucket_
 * functions. The ring is read here for tests, tools and dumps.
 */
#pragma once

#include <cstdint>
#include <vector>

#include "platform/tracing.h"

namespace host {

/* A bucket is full at first and gains its rate's tokens, each after a whole number of nanoseconds;
 * at a rate of 0 what is taken never comes back. A bucket that takes longer to fill than the kernel's
 * tick (some milliseconds) gets a tick's tokens together, at its end. */
struct TraceSettings {
  uint32_t slots = 16384; /* of the ring, a power of two */
  bool enabled = true;
  bool throttling = true;
  int32_t classLevel = 0;      /* of every class to begin with */
  bool notify = true;          /* wall-clock entries and notification */
  uint64_t perEventBurst = 64; /* tokens of a small bucket */
  uint64_t perEventPerSecond = 64;
  uint64_t globalBurst = 4096;
  uint64_t globalPerSecond = 4096;
};

/* Starts over: an empty ring, full buckets for streams of these settings, nothing notified. The
 * program starts with the settings' defaults. Nobody may be emitting or reading: the ring before is
 * gone. Throws std::invalid_argument when the slots are no power of two. */
void configureTracing(const TraceSettings &settings);

/* Any thread, while others emit. There are classes 0 to 63; another one is refused with a warning,
 * and its level stays below that of any event. */
void setTraceClassLevel(uint32_t traceClass, int32_t level);
void setTraceThrottling(bool on);
void setTraceEnabled(bool on);

/* The finished records of the ring from a sequence number on, oldest first: those whose phase and
 * sequence number belong to the last lap. Safe while others emit: what is unfinished, or
 * overwritten meanwhile, is left out. */
struct TracedRecord {
  uint64_t sequence;
  uint32_t type, id, site, processor;
  uint64_t timeNanoseconds;
  uint64_t payload[6];
};
std::vector<TracedRecord> readTrace(uint64_t from = 0);

/* The last 256 pairs of a record's time stamp and the wall clock (ns since 1970) at that moment. */
struct WallClockEntry {
  uint64_t sequence;
  uint64_t timeNanoseconds;
  uint64_t wallNanoseconds;
};
std::vector<WallClockEntry> wallClockEntries();
uint64_t traceNotifications(); /* calls of Trace_Notify so far */

}  // namespace host
