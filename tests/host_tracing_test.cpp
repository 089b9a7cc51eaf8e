/* The tracing library: buckets on a clock that the test turns, the ring as its readers see it. */
#include "host/tracing/tracing.h"

#include <gmock/gmock.h>

#include <atomic>
#include <bit>
#include <chrono>
#include <latch>
#include <stdexcept>
#include <thread>

using testing::ElementsAre;

namespace {
std::atomic<uint64_t> clockNanoseconds{0};
/* The stream that the program starts with, before any configuration. */
const void *streamAtStart = nullptr;
}  // namespace

extern "C" uint64_t zel_GetTimerCycles(void) {
  return clockNanoseconds * 2;
}
extern "C" uint64_t zel_TimerTCToNS(uint64_t cycles) {
  return cycles / 2;
}

namespace {

constexpr uint64_t kSecond = 1'000'000'000;

TraceStream &stream() {
  return *static_cast<TraceStream *>(traceStreamTables[1]);
}

TraceRecord &slot(uint64_t number) {
  auto *ring = reinterpret_cast<unsigned char *>(&stream()) + TRACE_STREAM_RING;
  return reinterpret_cast<TraceRecord *>(ring)[number];
}

void setBits(uint64_t &word, unsigned shift, unsigned width, uint64_t value) {
  const uint64_t mask = ((uint64_t{1} << width) - 1) << shift;
  const std::atomic_ref bits(word);
  bits.store((bits.load() & ~mask) | (value << shift & mask));
}

struct Event {
  uint64_t id = 1;
  uint64_t site = 485;
  uint64_t type = TRACE_RECORD_EVENT;
  uint64_t processor = 0;
};

/* All of a record but its phase bit, each field by a masked update, payload words 100, 101, ...
 * times the sequence number. */
uint64_t beginRecord(const Event &event) {
  const uint64_t sequence = std::atomic_ref(stream().sequence).fetch_add(1);
  TraceRecord &record = slot(sequence & stream().mask);
  setBits(record.word1, 35, 29, sequence);
  setBits(record.word0, 1, 8, event.processor);
  setBits(record.word1, 0, 6, event.type);
  setBits(record.word1, 6, 14, event.id);
  setBits(record.word1, 20, 15, event.site);
  setBits(record.word0, 9, 55, zel_TimerTCToNS(zel_GetTimerCycles()));
  for (uint64_t i = 0; i < 6; ++i) std::atomic_ref(record.payload[i]).store(sequence * (100 + i));
  return sequence;
}

void finishRecord(uint64_t sequence) {
  TraceRecord &record = slot(sequence & stream().mask);
  setBits(record.word0, 0, 1, ~(sequence >> stream().lapShift) & 1);
  if (stream().notifyHandle == 0) return;
  if (sequence % TRACE_WALL_CLOCK_EVERY == 0) Trace_CreateWallClockEntry(&stream(), &record);
  if (sequence % TRACE_NOTIFY_EVERY == 0) Trace_Notify(stream().notifyHandle);
}

void write(const Event &event = {}) {
  finishRecord(beginRecord(event));
}

std::vector<uint64_t> sequencesRead() {
  std::vector<uint64_t> sequences;
  for (const host::TracedRecord &record : host::readTrace()) sequences.push_back(record.sequence);
  return sequences;
}

class Tracing : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    if (streamAtStart == nullptr) streamAtStart = traceStreamTables[1];
  }
  Tracing() { host::configureTracing({}); }
};

/* ---- The stream ------------------------------------------------------------------------------ */

TEST_F(Tracing, HasAStreamBeforeAnyConfiguration) {
  ASSERT_NE(streamAtStart, nullptr);
  EXPECT_NE(stream().flags & TRACE_STREAM_ENABLED, 0);
}

TEST_F(Tracing, LaysTheStreamOutAsConfigured) {
  host::configureTracing({.slots = 64, .enabled = false, .throttling = false, .notify = false});
  EXPECT_EQ(stream().mask, 63u);
  EXPECT_EQ(stream().lapShift, 6u);
  EXPECT_EQ(stream().flags, 0u);
  EXPECT_EQ(stream().throttling, 0u);
  EXPECT_EQ(stream().notifyHandle, 0u);
  host::setTraceEnabled(true);
  host::setTraceThrottling(true);
  EXPECT_EQ(stream().flags, TRACE_STREAM_ENABLED);
  EXPECT_NE(stream().throttling, 0u);
}

TEST_F(Tracing, RefusesARingThatIsNoPowerOfTwo) {
  EXPECT_THROW(host::configureTracing({.slots = 100}), std::invalid_argument);
  EXPECT_THROW(host::configureTracing({.slots = 0}), std::invalid_argument);
}

TEST_F(Tracing, ReadsEveryFieldBack) {
  clockNanoseconds = 123'456'789;
  write();
  write({.id = 0x2aaa, .site = 0x5555, .type = TRACE_RECORD_THROTTLE, .processor = 0x1c3});
  const auto records = host::readTrace();
  ASSERT_EQ(records.size(), 2u);
  EXPECT_EQ(records[1].sequence, 1u);
  EXPECT_EQ(records[1].id, 0x2aaau);
  EXPECT_EQ(records[1].site, 0x5555u);
  EXPECT_EQ(records[1].type, TRACE_RECORD_THROTTLE);
  EXPECT_EQ(records[1].processor, 0xc3u);
  EXPECT_EQ(records[1].timeNanoseconds, 123'456'789u);
  EXPECT_THAT(records[1].payload, ElementsAre(100, 101, 102, 103, 104, 105));
}

TEST_F(Tracing, ReadsTheLastLapInOrder) {
  host::configureTracing({.slots = 4});
  EXPECT_THAT(sequencesRead(), ElementsAre());
  for (int i = 0; i < 3; ++i) write();
  EXPECT_THAT(sequencesRead(), ElementsAre(0, 1, 2));
  for (int i = 0; i < 3; ++i) write();
  EXPECT_THAT(sequencesRead(), ElementsAre(2, 3, 4, 5));
  for (int i = 0; i < 4; ++i) write(); /* in the third lap the phase is the first's again */
  EXPECT_THAT(sequencesRead(), ElementsAre(6, 7, 8, 9));
}

TEST_F(Tracing, LeavesUnfinishedRecordsOut) {
  host::configureTracing({.slots = 4});
  write();
  const uint64_t first = beginRecord({});
  write();
  EXPECT_THAT(sequencesRead(), ElementsAre(0, 2));
  finishRecord(first);
  write();
  const uint64_t overwriting = beginRecord({}); /* slot 0 now holds neither lap's record */
  EXPECT_THAT(sequencesRead(), ElementsAre(1, 2, 3));
  finishRecord(overwriting);
  EXPECT_THAT(sequencesRead(), ElementsAre(1, 2, 3, 4));
}

TEST_F(Tracing, ClaimedButUntouchedSlotsAreLeftOut) {
  host::configureTracing({.slots = 4});
  for (int i = 0; i < 8; ++i) write();
  std::atomic_ref(stream().sequence).fetch_add(1); /* claims 8, whose slot still holds 4 */
  EXPECT_THAT(sequencesRead(), ElementsAre(5, 6, 7));
}

TEST_F(Tracing, KeepsSequenceNumbersBeyondTheRecordsBits) {
  host::configureTracing({.slots = 4, .notify = true});
  const uint64_t start = (uint64_t{3} << 29) + TRACE_WALL_CLOCK_EVERY;
  stream().sequence = start;
  write();
  write();
  EXPECT_THAT(sequencesRead(), ElementsAre(start, start + 1));
  ASSERT_EQ(host::wallClockEntries().size(), 1u);
  EXPECT_EQ(host::wallClockEntries()[0].sequence, start);
}

/* Each record's payload follows from its sequence number, so a torn copy shows. The reader races
 * one emitter through as many laps as fit into its own reads. */
TEST_F(Tracing, ReadsNoTornRecordWhileEmittersRun) {
  host::configureTracing({.slots = 2});
  std::atomic<bool> stop{false};
  std::thread emitter([&] {
    while (!stop) write();
  });
  int torn = 0;
  for (uint64_t records = 0; records < 100'000;) {
    for (const host::TracedRecord &record : host::readTrace()) {
      ++records;
      for (uint64_t i = 0; i < 6; ++i) torn += record.payload[i] != record.sequence * (100 + i);
    }
  }
  stop = true;
  emitter.join();
  EXPECT_EQ(torn, 0);
}

/* ---- Classes, ids ---------------------------------------------------------------------------- */

TEST_F(Tracing, SetsClassLevelsOneByOne) {
  host::configureTracing({.classLevel = 2});
  host::setTraceClassLevel(36, 0);
  EXPECT_EQ(Trace_ClassLevelGet(35), 2);
  EXPECT_EQ(Trace_ClassLevelGet(36), 0);
  host::configureTracing({.classLevel = 1});
  EXPECT_EQ(Trace_ClassLevelGet(36), 1);
}

TEST_F(Tracing, NobodyWritesEventsOfAnUnknownClass) {
  host::configureTracing({.classLevel = 2});
  EXPECT_LT(Trace_ClassLevelGet(64), 0);
  host::setTraceClassLevel(0xffffffff, 2);
  EXPECT_LT(Trace_ClassLevelGet(0xffffffff), 0);
}

TEST_F(Tracing, NoticeIdsDifferAndFitTheirField) {
  EXPECT_NE(Trace_GetPerTraceThrottledTraceId(), Trace_GetGlobalThrottledTraceId());
  EXPECT_LT(Trace_GetPerTraceThrottledTraceId(), 1u << 14);
  EXPECT_LT(Trace_GetGlobalThrottledTraceId(), 1u << 14);
}

/* ---- Buckets --------------------------------------------------------------------------------- */

/* Both kinds by one interface: four tokens of burst, one token back every 250 ms. */
struct SmallBucket {
  TokenBucketMini bucket{};
  SmallBucket() { TokenBucket_InitMini(&bucket, perTraceTbConfig); }
  bool use(uint64_t tokens, uint64_t *left) {
    return TokenBucket_UseTokensMini(&bucket, perTraceTbConfig, tokens, left);
  }
  void *address() { return &bucket; }
};
struct GlobalBucket {
  bool use(uint64_t tokens, uint64_t *left) {
    return TokenBucket_UseTokens(&stream().globalBucket, tokens, left);
  }
  void *address() { return &stream().globalBucket; }
};

host::TraceSettings fourTokens(uint64_t perSecond) {
  return {.perEventBurst = 4,
          .perEventPerSecond = perSecond,
          .globalBurst = 4,
          .globalPerSecond = perSecond};
}

template <typename Bucket>
class Buckets : public Tracing {
 protected:
  /* Tokens left when `tokens` were granted; -1 - tokens left when they were refused. */
  int64_t use(uint64_t tokens = 1) {
    uint64_t left = 0xdead;
    const bool granted = bucket.use(tokens, &left);
    return granted ? static_cast<int64_t>(left) : -1 - static_cast<int64_t>(left);
  }
  uint64_t wait() { return TokenBucket_TimeToGetTokens(bucket.address()); }
  void empty() {
    while (use() >= 0) {
    }
  }

 private:
  struct Configured {
    Configured() {
      clockNanoseconds = 0;
      host::configureTracing(fourTokens(4));
    }
  } configured_;

 protected:
  Bucket bucket;
};
using BucketKinds = testing::Types<SmallBucket, GlobalBucket>;
TYPED_TEST_SUITE(Buckets, BucketKinds);

TYPED_TEST(Buckets, GrantTheBurstThenRefuseAndTellWhatIsLeft) {
  EXPECT_EQ(this->wait(), 0u);
  EXPECT_EQ(this->use(), 3);
  EXPECT_EQ(this->use(2), 1);
  EXPECT_EQ(this->use(2), -1 - 1); /* refused: the token left stays */
  EXPECT_EQ(this->use(), 0);
  EXPECT_EQ(this->use(), -1 - 0);
}

TYPED_TEST(Buckets, GrantOneTokenAnInterval) {
  this->empty();
  EXPECT_EQ(this->wait(), kSecond / 4);
  clockNanoseconds += kSecond / 4 - 1;
  EXPECT_EQ(this->wait(), 1u);
  EXPECT_EQ(this->use(), -1);
  clockNanoseconds += 1;
  EXPECT_EQ(this->wait(), 0u);
  EXPECT_EQ(this->use(), 0);
  EXPECT_EQ(this->use(), -1);
}

TYPED_TEST(Buckets, KeepPartsOfIntervals) {
  this->empty();
  clockNanoseconds += kSecond * 3 / 8; /* one and a half */
  EXPECT_EQ(this->use(), 0);
  clockNanoseconds += kSecond / 8;
  EXPECT_EQ(this->use(), 0);
}

TYPED_TEST(Buckets, NeverHoldMoreThanTheBurst) {
  this->empty();
  clockNanoseconds += 1000 * kSecond;
  EXPECT_EQ(this->use(), 3);
  EXPECT_EQ(this->use(5), -1 - 3);
}

TYPED_TEST(Buckets, WithoutARateGiveTheirBurstOnce) {
  host::configureTracing(fourTokens(0));
  this->bucket = {};
  EXPECT_EQ(this->use(4), 0);
  clockNanoseconds += 1000 * kSecond;
  EXPECT_EQ(this->use(), -1);
  EXPECT_EQ(this->wait(), UINT64_MAX);
}

TYPED_TEST(Buckets, WithoutABurstGrantNothing) {
  host::configureTracing({.perEventBurst = 0, .globalBurst = 0});
  this->bucket = {};
  EXPECT_EQ(this->use(), -1);
  EXPECT_EQ(this->wait(), UINT64_MAX);
}

TYPED_TEST(Buckets, GrantHugeRequestsToNobody) {
  EXPECT_EQ(this->use(UINT64_MAX), -1 - 4);
  host::configureTracing({.perEventBurst = UINT64_MAX, .globalBurst = UINT64_MAX});
  this->bucket = {};
  EXPECT_EQ(this->use(UINT64_MAX) < 0, true);
  EXPECT_GT(this->use(), 1'000'000);
}

TYPED_TEST(Buckets, GrantEachTokenToOneThread) {
  constexpr int kTokens = 1'000'000;
  host::TraceSettings settings{.perEventBurst = kTokens, .globalBurst = kTokens};
  settings.perEventPerSecond = settings.globalPerSecond = 0;
  host::configureTracing(settings);
  this->bucket = {};
  std::atomic<int> granted{0};
  std::atomic<int> lastTokens{0};
  std::latch ready(2);
  const auto taker = [&] {
    ready.arrive_and_wait();
    int mine = 0;
    for (int i = 0; i < kTokens; ++i) {
      const int64_t left = this->use();
      if (left >= 0) ++mine;
      if (left == 0) ++lastTokens;
    }
    granted += mine;
  };
  std::thread one(taker);
  std::thread two(taker);
  one.join();
  two.join();
  EXPECT_EQ(granted, kTokens);
  EXPECT_EQ(lastTokens, 1);
}

TEST_F(Tracing, TellsTheWaitOfEachBucketByItsOwnRate) {
  host::configureTracing(
      {.perEventBurst = 1, .perEventPerSecond = 10, .globalBurst = 1, .globalPerSecond = 1000});
  TokenBucketMini small;
  TokenBucket_InitMini(&small, perTraceTbConfig);
  uint64_t left = 0;
  ASSERT_TRUE(TokenBucket_UseTokensMini(&small, perTraceTbConfig, 1, &left));
  ASSERT_TRUE(TokenBucket_UseTokens(&stream().globalBucket, 1, &left));
  EXPECT_EQ(TokenBucket_TimeToGetTokens(&small), kSecond / 10);
  EXPECT_EQ(TokenBucket_TimeToGetTokens(&stream().globalBucket), kSecond / 1000);
}

TEST_F(Tracing, ASmallBucketThatNobodyFilledGathersFromTheClocksZero) {
  host::configureTracing(fourTokens(4));
  TokenBucketMini bucket{};
  uint64_t left = 0;
  clockNanoseconds = 0;
  EXPECT_FALSE(TokenBucket_UseTokensMini(&bucket, perTraceTbConfig, 1, &left));
  clockNanoseconds = 60 * kSecond;
  EXPECT_TRUE(TokenBucket_UseTokensMini(&bucket, perTraceTbConfig, 1, &left));
  EXPECT_EQ(left, 3u);
}

/* ---- Readers' services ----------------------------------------------------------------------- */

TEST_F(Tracing, TiesEvery2048thRecordToTheWallClock) {
  const auto before =
      std::chrono::system_clock::now().time_since_epoch() / std::chrono::nanoseconds(1);
  clockNanoseconds = 5000;
  for (uint64_t i = 0; i <= 2 * TRACE_WALL_CLOCK_EVERY; ++i) write();
  const auto after =
      std::chrono::system_clock::now().time_since_epoch() / std::chrono::nanoseconds(1);
  const auto entries = host::wallClockEntries();
  ASSERT_EQ(entries.size(), 3u);
  EXPECT_EQ(entries[1].sequence, TRACE_WALL_CLOCK_EVERY);
  EXPECT_EQ(entries[1].timeNanoseconds, 5000u);
  EXPECT_GE(entries[0].wallNanoseconds, static_cast<uint64_t>(before));
  EXPECT_LE(entries[2].wallNanoseconds, static_cast<uint64_t>(after));
  EXPECT_EQ(host::traceNotifications(), 2 * TRACE_WALL_CLOCK_EVERY / TRACE_NOTIFY_EVERY + 1);
}

TEST_F(Tracing, KeepsABoundedNumberOfWallClockEntriesTheLastOnes) {
  for (int i = 0; i < 1000; ++i) {
    stream().sequence = static_cast<uint64_t>(i) * TRACE_WALL_CLOCK_EVERY;
    write();
  }
  const auto entries = host::wallClockEntries();
  ASSERT_EQ(entries.size(), 256u);
  EXPECT_EQ(entries.front().sequence, 744 * TRACE_WALL_CLOCK_EVERY);
  EXPECT_EQ(entries.back().sequence, 999 * TRACE_WALL_CLOCK_EVERY);
}

TEST_F(Tracing, ForeignHandlesNotifyNobody) {
  Trace_Notify(stream().notifyHandle + 1);
  EXPECT_EQ(host::traceNotifications(), 0u);
}

TEST_F(Tracing, ConfiguringStartsOver) {
  host::configureTracing(fourTokens(4));
  uint64_t left = 0;
  EXPECT_TRUE(TokenBucket_UseTokens(&stream().globalBucket, 4, &left));
  write();
  host::configureTracing(fourTokens(4));
  EXPECT_THAT(sequencesRead(), ElementsAre());
  EXPECT_THAT(host::wallClockEntries(), testing::IsEmpty());
  EXPECT_EQ(host::traceNotifications(), 0u);
  EXPECT_TRUE(TokenBucket_UseTokens(&stream().globalBucket, 4, &left));
}

}  // namespace
