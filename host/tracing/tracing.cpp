/* The stream of the product's modules: its ring, class levels, wall-clock entries and notification.
 * Emitters take no lock and must never wait, so the ring and the switches are atomics; the short
 * store of wall-clock entries has a lock of its own, taken once in 2,048 records.
 */
#include "host/tracing/tracing.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <bit>
#include <chrono>
#include <cstring>
#include <mutex>
#include <new>
#include <stdexcept>
#include <string>

#include "host/kernel/log.h"
#include "host/tracing/token_bucket.h"

extern "C" {
/* Streams of other products are not served: their elements stay null. */
void *traceStreamTables[4];
}

namespace host {

namespace {

constexpr size_t kModulesStream = 1;
constexpr size_t kClasses = 64;
constexpr int32_t kNoSuchClass = -1; /* below the level of any event */
constexpr size_t kMostWallClockEntries = 256;
constexpr uint64_t kNotifyHandle = 1;

/* The last two of the 14-bit ids, out of the way of every module's events. */
constexpr uint32_t kPerTraceThrottledId = 0x3ffe;
constexpr uint32_t kGlobalThrottledId = 0x3fff;

constexpr uint64_t kSequenceMask = (1u << 29) - 1;
constexpr uint64_t kPhaseBit = 1;

/* Read at every trace statement of a module, so without a way round to them. */
constinit std::array<std::atomic<int32_t>, kClasses> levels{};

struct Tracing {
  std::atomic<uint64_t> notifications{0};
  std::mutex wallClockMutex;
  std::array<WallClockEntry, kMostWallClockEntries> wallClock{};
  uint64_t wallClockCount = 0; /* ever made; the array keeps the last ones */
};

/* Never destroyed: threads may emit until the very end of the program. */
Tracing &tracing() {
  static auto *everlasting = new Tracing;
  return *everlasting;
}

TraceStream &modulesStream() {
  return *static_cast<TraceStream *>(traceStreamTables[kModulesStream]);
}

constexpr std::align_val_t kStreamAlignment{64};

/* A stream of zeros, which has no finished record, since the first lap's phase is 1. One of the
 * same size is used again: no more of it needs to be cleared than was written. */
TraceStream *emptyStream(uint32_t slots, TraceStream *before) {
  const bool again = before != nullptr && before->mask == slots - 1;
  const size_t size = TRACE_STREAM_RING + size_t{slots} * sizeof(TraceRecord);
  const size_t written = again ? std::min<uint64_t>(before->sequence, slots) : slots;
  void *memory = again ? before : ::operator new(size, kStreamAlignment);
  std::memset(memory, 0, TRACE_STREAM_RING + written * sizeof(TraceRecord));
  if (!again) ::operator delete(before, kStreamAlignment);
  return static_cast<TraceStream *>(memory);
}

TraceStream *newStream(const TraceSettings &settings, TraceStream *before) {
  TraceStream *stream = emptyStream(settings.slots, before);
  stream->mask = settings.slots - 1;
  stream->lapShift = static_cast<uint16_t>(std::countr_zero(settings.slots));
  stream->throttling = settings.throttling ? 1 : 0;
  stream->flags = settings.enabled ? TRACE_STREAM_ENABLED : 0;
  stream->notifyHandle = settings.notify ? kNotifyHandle : 0;
  initTokenBucket(stream->globalBucket, {settings.globalBurst, settings.globalPerSecond});
  return stream;
}

/* Emitters find a stream from the program's first moment on. */
[[maybe_unused]] const bool configuredAtStart = (configureTracing({}), true);

TraceRecord *ringOf(TraceStream &stream) {
  return reinterpret_cast<TraceRecord *>(reinterpret_cast<unsigned char *>(&stream) +
                                         TRACE_STREAM_RING);
}

uint64_t load(uint64_t &word) {
  return std::atomic_ref(word).load(std::memory_order_acquire);
}

/* The full sequence number behind a record's 29 bits: the last one not above what was handed out.
 */
uint64_t sequenceOf(uint64_t word1, TraceStream &stream) {
  const uint64_t next = load(stream.sequence);
  return next - ((next - (word1 >> 35)) & kSequenceMask);
}

bool isFinished(uint64_t word0, uint64_t word1, uint64_t sequence, const TraceStream &stream) {
  const uint64_t phase = ~(sequence >> stream.lapShift) & kPhaseBit;
  return (word0 & kPhaseBit) == phase && word1 >> 35 == (sequence & kSequenceMask);
}

/* Copies record `sequence` out; false when it is not finished, or was overwritten while it was
 * read. An emitter writes the sequence number first and the phase last: a record that has both,
 * before and after the copy, was whole all the time. */
bool readRecord(TraceStream &stream, uint64_t sequence, TracedRecord &out) {
  TraceRecord &record = ringOf(stream)[sequence & stream.mask];
  const uint64_t word0 = load(record.word0);
  const uint64_t word1 = load(record.word1);
  if (!isFinished(word0, word1, sequence, stream)) return false;
  out.sequence = sequence;
  out.type = word1 & 0x3f;
  out.id = word1 >> 6 & 0x3fff;
  out.site = word1 >> 20 & 0x7fff;
  out.processor = word0 >> 1 & 0xff;
  out.timeNanoseconds = word0 >> 9;
  for (size_t i = 0; i < std::size(out.payload); ++i) out.payload[i] = load(record.payload[i]);
  return load(record.word1) == word1 && load(record.word0) == word0;
}

}  // namespace

void configureTracing(const TraceSettings &settings) {
  if (!std::has_single_bit(settings.slots)) {
    throw std::invalid_argument("a trace ring of " + std::to_string(settings.slots) +
                                " slots: the number must be a power of two");
  }
  Tracing &all = tracing();
  auto &stream = traceStreamTables[kModulesStream];
  stream = newStream(settings, static_cast<TraceStream *>(stream));
  setMiniBucketRate({settings.perEventBurst, settings.perEventPerSecond});
  for (auto &level : levels) level = settings.classLevel;
  all.notifications = 0;
  {
    const std::lock_guard guard(all.wallClockMutex);
    all.wallClockCount = 0;
  }
}

void setTraceClassLevel(uint32_t traceClass, int32_t level) {
  if (traceClass >= kClasses) {
    logWarning("trace class %u does not exist: there are classes 0 to %zu", traceClass,
               kClasses - 1);
    return;
  }
  levels[traceClass].store(level, std::memory_order_relaxed);
}

void setTraceThrottling(bool on) {
  std::atomic_ref(modulesStream().throttling).store(on ? 1 : 0, std::memory_order_relaxed);
}

void setTraceEnabled(bool on) {
  std::atomic_ref(modulesStream().flags)
      .store(on ? TRACE_STREAM_ENABLED : 0, std::memory_order_relaxed);
}

std::vector<TracedRecord> readTrace(uint64_t from) {
  TraceStream &stream = modulesStream();
  const uint64_t end = load(stream.sequence);
  const uint64_t slots = stream.mask + 1;
  std::vector<TracedRecord> records;
  from = std::max(from, end > slots ? end - slots : 0);
  for (uint64_t sequence = from; sequence < end; ++sequence) {
    TracedRecord record{};
    if (readRecord(stream, sequence, record)) records.push_back(record);
  }
  return records;
}

std::vector<WallClockEntry> wallClockEntries() {
  Tracing &all = tracing();
  const std::lock_guard guard(all.wallClockMutex);
  const uint64_t count = all.wallClockCount;
  std::vector<WallClockEntry> entries;
  for (uint64_t i = count > kMostWallClockEntries ? count - kMostWallClockEntries : 0; i < count;
       ++i) {
    entries.push_back(all.wallClock[i % kMostWallClockEntries]);
  }
  return entries;
}

uint64_t traceNotifications() {
  return tracing().notifications;
}

}  // namespace host

using namespace host;

extern "C" {

/* Asked at every trace statement: in one window of the processor's decoder, wherever the linker puts
 * it. Across two, it takes half as long again. */
__attribute__((aligned(32))) int32_t Trace_ClassLevelGet(uint32_t traceClass) {
  if (traceClass >= kClasses) return kNoSuchClass;
  return levels[traceClass].load(std::memory_order_relaxed);
}

uint64_t TokenBucket_TimeToGetTokens(void *bucket) {
  if (bucket == &modulesStream().globalBucket) {
    return timeToToken(*static_cast<TokenBucket *>(bucket));
  }
  return timeToToken(*static_cast<TokenBucketMini *>(bucket));
}

uint32_t Trace_GetPerTraceThrottledTraceId(void) {
  return kPerTraceThrottledId;
}
uint32_t Trace_GetGlobalThrottledTraceId(void) {
  return kGlobalThrottledId;
}

void Trace_CreateWallClockEntry(void *stream, TraceRecord *record) {
  Tracing &all = tracing();
  if (stream != &modulesStream()) return;
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  const uint64_t wall =
      static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(now).count());
  const WallClockEntry entry{sequenceOf(load(record->word1), modulesStream()),
                             load(record->word0) >> 9, wall};
  const std::lock_guard guard(all.wallClockMutex);
  all.wallClock[all.wallClockCount++ % kMostWallClockEntries] = entry;
}

void Trace_Notify(uint64_t handle) {
  if (handle == kNotifyHandle) tracing().notifications.fetch_add(1, std::memory_order_relaxed);
}

}  // extern "C"
