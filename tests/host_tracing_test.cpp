/* The tracing library: buckets on a clock that the test turns, the ring as its readers see it. */
#include "host/tracing/tracing.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <optional>
#include <stdexcept>
#include <thread>

#include "host/threads/clock.h"

using namespace testing;

namespace {
std::atomic<uint64_t> clockNanoseconds{0};
std::atomic<uint64_t> tick{1}; /* ns */
}  // namespace

extern "C" uint64_t zel_GetTimerCycles(void) {
  return clockNanoseconds * 2;
}
extern "C" uint64_t zel_TimerTCToNS(uint64_t cycles) {
  return cycles / 2;
}
constinit host::SystemClock host::systemClock = [](clockid_t, timespec *now) {
  *now = {0, static_cast<long>(clockNanoseconds / tick * tick)};
  return 0;
};
uint64_t host::tickInterval() {
  return tick;
}

namespace {

constexpr uint64_t kSecond = 1'000'000'000;

TraceStream &stream() {
  return *static_cast<TraceStream *>(traceStreamTables[1]);
}

TraceRecord &slot(uint64_t sequence) {
  auto *ring = reinterpret_cast<unsigned char *>(&stream()) + TRACE_STREAM_RING;
  return reinterpret_cast<TraceRecord *>(ring)[sequence & stream().mask];
}

/* All of a record but its phase bit, in an emitter's order: the sequence number first. Payload
 * words 100, 101, ... times the sequence number. */
uint64_t beginRecord(uint64_t id = 1, uint64_t site = 485, uint64_t type = TRACE_RECORD_EVENT) {
  const uint64_t sequence = std::atomic_ref(stream().sequence).fetch_add(1);
  TraceRecord &record = slot(sequence);
  const std::atomic_ref word0(record.word0);
  std::atomic_ref(record.word1) = sequence << 35 | site << 20 | id << 6 | type;
  word0 = clockNanoseconds << 9 | 0xc3 << 1 | (word0 & 1);
  for (uint64_t i = 0; i < 6; ++i) std::atomic_ref(record.payload[i]) = sequence * (100 + i);
  return sequence;
}

void finishRecord(uint64_t sequence) {
  const std::atomic_ref word0(slot(sequence).word0);
  word0 = (word0 & ~uint64_t{1}) | (~(sequence >> stream().lapShift) & 1);
}

void write(int records = 1) {
  while (records-- > 0) finishRecord(beginRecord());
}

std::vector<uint64_t> sequencesRead() {
  std::vector<uint64_t> sequences;
  for (const host::TracedRecord &record : host::readTrace()) sequences.push_back(record.sequence);
  return sequences;
}

struct Tracing : Test {
  Tracing() {
    EXPECT_NE(traceStreamTables[1], nullptr) << "emitters find a stream from the start";
    host::configureTracing({.slots = 4});
  }
};

/* ---- The stream ------------------------------------------------------------------------------ */

TEST_F(Tracing, StartsOverWhenItIsConfigured) {
  write();
  Trace_CreateWallClockEntry(&stream(), &slot(0));
  Trace_Notify(stream().notifyHandle);
  EXPECT_EQ(host::traceNotifications(), 1u);
  host::configureTracing({.slots = 4, .notify = false});
  beginRecord(); /* where a finished one stood */
  EXPECT_EQ(host::readTrace().size() + host::wallClockEntries().size(), 0u);
  EXPECT_EQ(host::traceNotifications() + stream().notifyHandle, 0u);
  EXPECT_THROW(host::configureTracing({.slots = 100}), std::invalid_argument);
}

TEST_F(Tracing, ReadsTheLastLapInOrderWithoutWhatIsUnfinishedAndEveryField) {
  write();
  const uint64_t first = beginRecord();
  write();
  EXPECT_THAT(sequencesRead(), ElementsAre(0, 2));
  finishRecord(first);
  write();
  const uint64_t overwriting = beginRecord(); /* slot 0 now holds neither lap's record */
  EXPECT_THAT(sequencesRead(), ElementsAre(1, 2, 3));
  finishRecord(overwriting);
  write(5); /* in the third lap the phase is the first's again */
  EXPECT_THAT(sequencesRead(), ElementsAre(6, 7, 8, 9));
  clockNanoseconds = 123'456'789;
  finishRecord(beginRecord(0x2aaa, 0x5555, TRACE_RECORD_THROTTLE));
  EXPECT_THAT(host::readTrace().back(),
              FieldsAre(10, TRACE_RECORD_THROTTLE, 0x2aaa, 0x5555, 0xc3, 123'456'789,
                        ElementsAre(1000, 1010, 1020, 1030, 1040, 1050)));
  std::atomic_ref(stream().sequence).fetch_add(1); /* claimed; the slot still holds 7 */
  EXPECT_THAT(sequencesRead(), ElementsAre(8, 9, 10));
}

/* Each record's payload follows from its sequence number, so a torn copy shows. The reader races
 * one emitter through as many laps as fit into its own reads. */
TEST_F(Tracing, ReadsNoTornRecordWhileEmittersRun) {
  host::configureTracing({.slots = 2});
  const std::jthread emitter([&](const std::stop_token &stop) {
    while (!stop.stop_requested()) write();
  });
  for (uint64_t seen = 0, last = 0; seen < 100'000;) {
    for (const host::TracedRecord &record : host::readTrace()) {
      seen += record.sequence > last; /* only what the emitter wrote meanwhile */
      last = std::max(last, record.sequence);
      for (uint64_t i = 0; i < 6; ++i) ASSERT_EQ(record.payload[i], record.sequence * (100 + i));
    }
  }
}

TEST_F(Tracing, KeepsTheLastWallClockEntriesWithFullSequenceNumbers) {
  const uint64_t start = (uint64_t{3} << 29) - 500; /* a record holds 29 bits of it */
  stream().sequence = start;
  clockNanoseconds = 5000;
  for (uint64_t i = 0; i < 1000; ++i) {
    write();
    Trace_CreateWallClockEntry(&stream(), &slot(start + i));
  }
  const auto entries = host::wallClockEntries();
  ASSERT_EQ(entries.size(), 256u);
  EXPECT_THAT(entries.front(), FieldsAre(start + 744, 5000, Gt(0u)));
  EXPECT_EQ(entries.back().sequence, start + 999);
}

/* ---- Buckets --------------------------------------------------------------------------------- */

/* A bucket of one kind, full at the clock's zero; the other kind keeps another rate. */
struct Bucket {
  Bucket(bool isSmall, uint64_t burst, uint64_t perSecond) : small(isSmall) {
    clockNanoseconds = 0;
    host::TraceSettings settings;
    (small ? settings.perEventBurst : settings.globalBurst) = burst;
    (small ? settings.perEventPerSecond : settings.globalPerSecond) = perSecond;
    host::configureTracing(settings);
    TokenBucket_InitMini(&own, perTraceTbConfig);
  }
  /* How many are left when `tokens` were granted. */
  std::optional<uint64_t> use(uint64_t tokens = 1) {
    uint64_t left = 0xdead;
    if (small ? TokenBucket_UseTokensMini(&own, perTraceTbConfig, tokens, &left)
              : TokenBucket_UseTokens(&stream().globalBucket, tokens, &left)) {
      return left;
    }
    return std::nullopt;
  }
  uint64_t wait() {
    if (small) return TokenBucket_TimeToGetTokens(&own);
    return TokenBucket_TimeToGetTokens(&stream().globalBucket);
  }

  const bool small;
  TokenBucketMini own{};
};

TEST_F(Tracing, BucketsGrantTheBurstThenOneTokenAnInterval) {
  constexpr uint64_t kNever = UINT64_MAX;
  for (const bool small : {false, true}) {
    SCOPED_TRACE(small);
    Bucket bucket(small, 4, 4);
    EXPECT_EQ(bucket.use(UINT64_MAX), std::nullopt);
    EXPECT_EQ(bucket.use(3), 1u);
    EXPECT_EQ(bucket.use(2), std::nullopt);
    EXPECT_EQ(bucket.use(1), 0u) << "what was refused left it there";
    EXPECT_EQ(bucket.use(1), std::nullopt);
    EXPECT_EQ(bucket.use(0), 0u) << "none can always be had";
    clockNanoseconds = kSecond / 4 - 1;
    EXPECT_EQ(bucket.wait(), 1u);
    EXPECT_EQ(bucket.use(), std::nullopt);
    clockNanoseconds = kSecond / 8 * 3;
    EXPECT_EQ(bucket.wait(), 0u);
    EXPECT_EQ(bucket.use(), 0u);
    EXPECT_EQ(bucket.wait(), kSecond / 8) << "the half token is kept";
    clockNanoseconds = kSecond * 1000;
    EXPECT_EQ(bucket.use(5), std::nullopt);
    EXPECT_EQ(bucket.use(4), 0u);

    Bucket once(small, 4, 0);
    EXPECT_EQ(once.use(4), 0u);
    clockNanoseconds = kSecond * 1000;
    EXPECT_EQ(std::pair(once.wait(), once.use()), std::pair(kNever, std::optional<uint64_t>()));
    Bucket none(small, 0, 4);
    EXPECT_EQ(std::pair(none.wait(), none.use()), std::pair(kNever, std::optional<uint64_t>()));
    EXPECT_GT(Bucket(small, UINT64_MAX, 4).use(), 1'000'000u) << "no overflow";
  }
  TokenBucketMini zero{}; /* that nobody filled: gathers from the clock's zero on */
  EXPECT_GT(TokenBucket_TimeToGetTokens(&zero), 0u);
  clockNanoseconds = 60 * kSecond;
  EXPECT_EQ(TokenBucket_TimeToGetTokens(&zero), 0u);
}

/* In one second, asked all the time: its rate's tokens, whether a tick's fill the bucket or not. */
TEST_F(Tracing, BucketsLoseNoTokenBetweenTicks) {
  tick = 4'000'000;
  const std::array<uint64_t, 3> rows[] = {
      {1, 10'000, 9'999}, {8, 2'000, 1'992} /* the last tick's come in the next */, {64, 50, 49}};
  for (const auto &[burst, perSecond, granted] : rows) {
    Bucket bucket(true, burst, perSecond);
    bucket.use(burst);
    uint64_t count = 0;
    for (; clockNanoseconds < kSecond; clockNanoseconds += 10'000)
      count += bucket.use().has_value();
    EXPECT_EQ(count, granted) << perSecond;
  }
  tick = 1;
}

TEST_F(Tracing, BucketsGrantEachTokenToOneThread) {
  constexpr int kTokens = 1'000'000;
  Bucket bucket(true, kTokens, 0);
  std::atomic<int> granted{0};
  const auto taker = [&] {
    int mine = 0;
    for (int i = 0; i < kTokens; ++i) mine += bucket.use().has_value();
    granted += mine;
  };
  { const std::jthread one(taker), two(taker); }
  EXPECT_EQ(granted, kTokens);
}

}  // namespace
