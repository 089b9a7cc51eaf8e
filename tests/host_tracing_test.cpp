/* The tracing library: buckets on a clock that the test turns, the ring as its readers see it. */
#include "host/tracing/tracing.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
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
  Trace_Notify(stream().notifyHandle + 1); /* nobody's */
  EXPECT_EQ(host::traceNotifications(), 1u);
  host::configureTracing(
      {.slots = 4, .enabled = false, .throttling = false, .classLevel = 2, .notify = false});
  beginRecord(); /* where a finished one stood */
  EXPECT_EQ(host::readTrace().size() + host::wallClockEntries().size(), 0u);
  EXPECT_EQ(host::traceNotifications(), 0u);
  EXPECT_EQ(Trace_ClassLevelGet(35), 2);
  EXPECT_EQ(stream().flags | stream().throttling | stream().notifyHandle, 0u);
  for (const uint32_t slots : {0, 100}) {
    EXPECT_THROW(host::configureTracing({.slots = slots}), std::invalid_argument);
  }
  host::setTraceClassLevel(64, 2);
  EXPECT_LT(Trace_ClassLevelGet(64), 0) << "no such class: below any event";
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
  const auto before = std::chrono::system_clock::now().time_since_epoch().count();
  for (uint64_t i = 0; i < 1000; ++i) {
    write();
    Trace_CreateWallClockEntry(&stream(), &slot(start + i));
  }
  const auto entries = host::wallClockEntries();
  ASSERT_EQ(entries.size(), 256u);
  EXPECT_THAT(entries.front(), FieldsAre(start + 744, 5000, Ge(before)));
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
  /* Tokens left when `tokens` were granted; -1 - tokens left when they were refused. */
  int64_t use(uint64_t tokens = 1) {
    uint64_t left = 0xdead;
    const bool granted = small ? TokenBucket_UseTokensMini(&own, perTraceTbConfig, tokens, &left)
                               : TokenBucket_UseTokens(&stream().globalBucket, tokens, &left);
    return granted ? static_cast<int64_t>(left) : -1 - static_cast<int64_t>(left);
  }
  uint64_t wait() {
    if (small) return TokenBucket_TimeToGetTokens(&own);
    return TokenBucket_TimeToGetTokens(&stream().globalBucket);
  }

  const bool small;
  TokenBucketMini own{};
};

constexpr uint64_t kNever = UINT64_MAX;
struct Use {
  uint64_t clock, wait, tokens; /* when, how long until there is one, how many are asked for */
  int64_t left;                 /* as above */
};
const struct {
  uint64_t burst, perSecond;
  std::vector<Use> uses;
} lives[] = {
    {4,
     4,
     {{0, 0, UINT64_MAX, -1 - 4},
      {0, 0, 1, 3},
      {0, 0, 2, 1},
      {0, 0, 2, -1 - 1}, /* refused: the token left stays */
      {0, 0, 1, 0},
      {0, kSecond / 4, 1, -1},
      {0, kSecond / 4, 0, 0}, /* none can always be had */
      {kSecond / 4 - 1, 1, 1, -1},
      {kSecond / 8 * 3, 0, 1, 0}, /* one and a half; the half is kept */
      {kSecond / 8 * 3, kSecond / 8, 1, -1},
      {kSecond / 2, 0, 1, 0},
      {kSecond * 1000, 0, 5, -1 - 4}}},
    {4, 0, {{0, 0, 4, 0}, {kSecond * 1000, kNever, 1, -1}}}, /* no refill: the burst once */
    {0, 4, {{0, kNever, 1, -1}}},                            /* no burst: nothing ever */
};

TEST_F(Tracing, BucketsGrantTheBurstThenOneTokenAnInterval) {
  for (const bool small : {false, true}) {
    for (const auto &[burst, perSecond, uses] : lives) {
      Bucket bucket(small, burst, perSecond);
      for (const auto &[clock, wait, tokens, left] : uses) {
        clockNanoseconds = clock;
        EXPECT_EQ(bucket.wait(), wait) << small << burst << " at " << clock;
        EXPECT_EQ(bucket.use(tokens), left) << small << burst << " at " << clock;
      }
    }
    Bucket boundless(small, UINT64_MAX, 4);
    EXPECT_LT(boundless.use(UINT64_MAX), 0);
    EXPECT_GT(boundless.use(), 1'000'000) << "no overflow";
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
    for (; clockNanoseconds < kSecond; clockNanoseconds += 10'000) count += bucket.use() >= 0;
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
    for (int i = 0; i < kTokens; ++i) mine += bucket.use() >= 0;
    granted += mine;
  };
  { const std::jthread one(taker), two(taker); }
  EXPECT_EQ(granted, kTokens);
}

}  // namespace
