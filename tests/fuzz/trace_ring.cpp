/* Any bytes as the content of the trace ring: 8 of them the stream's sequence number, one the ring's
 * size, the rest its records. What is read must be finished records of the last lap, in order, with
 * the values that stand in their slots. One thread, no lock.
 */
#include <algorithm>
#include <cstring>

#include "host/tracing/tracing.h"
#include "tests/fuzz/target.h"

namespace {

constexpr uint64_t modulesStream = 1;
constexpr size_t headerSize = 9;

TraceStream &stream() {
  return *static_cast<TraceStream *>(traceStreamTables[modulesStream]);
}

TraceRecord *ring() {
  return reinterpret_cast<TraceRecord *>(reinterpret_cast<uint8_t *>(&stream()) +
                                         TRACE_STREAM_RING);
}

void fillStream(const uint8_t *data, size_t size) {
  uint64_t sequence;
  std::memcpy(&sequence, data, sizeof sequence);
  host::TraceSettings settings;
  settings.slots = 1u << (data[headerSize - 1] % 6);
  host::configureTracing(settings);
  stream().sequence = sequence;
  const size_t room = settings.slots * sizeof(TraceRecord);
  std::memcpy(ring(), data + headerSize, std::min(size - headerSize, room));
}

/* The phase bit of a finished record: 1 in the first lap, then alternating. */
uint64_t phaseOf(uint64_t sequence) {
  return (sequence >> stream().lapShift) % 2 == 0 ? 1 : 0;
}

void requireFinished(const host::TracedRecord &read) {
  const TraceRecord &slot = ring()[read.sequence % (stream().mask + 1)];
  FUZZ_REQUIRE((slot.word0 & 1) == phaseOf(read.sequence));
  FUZZ_REQUIRE(slot.word1 >> 35 == read.sequence % (1u << 29));
  FUZZ_REQUIRE(slot.word0 == (read.timeNanoseconds << 9 | uint64_t{read.processor} << 1 |
                              phaseOf(read.sequence)));
  FUZZ_REQUIRE(slot.word1 << 29 >> 29 ==
               (uint64_t{read.site} << 20 | uint64_t{read.id} << 6 | read.type));
  FUZZ_REQUIRE(std::memcmp(slot.payload, read.payload, sizeof slot.payload) == 0);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size < headerSize) return 0;
  fillStream(data, size);
  const auto records = host::readTrace();
  for (size_t i = 0; i < records.size(); i++) {
    FUZZ_REQUIRE(i == 0 || records[i - 1].sequence < records[i].sequence);
    FUZZ_REQUIRE(stream().sequence - records[i].sequence - 1 <= stream().mask);
    requireFinished(records[i]);
  }
  Trace_CreateWallClockEntry(&stream(), &ring()[0]);
  const auto entries = host::wallClockEntries();
  FUZZ_REQUIRE(entries.size() == 1);
  FUZZ_REQUIRE(entries[0].timeNanoseconds == ring()[0].word0 >> 9);
  FUZZ_REQUIRE(entries[0].sequence % (1u << 29) == ring()[0].word1 >> 35);
  return 0;
}
