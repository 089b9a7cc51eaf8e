/* The tracing library: buckets on a clock that the test turns, the ring as its readers see it. */
#include "host/tracing/tracing.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <stdexcept>
#include <string_view>
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
uint64_t host::tickNanoseconds() {
  return clockNanoseconds / tick * tick;
}
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

class Tracing : public Test {
 protected:
  Tracing() {
    EXPECT_NE(traceStreamTables[1], nullptr) << "emitters find a stream from the start";
    host::configureTracing({.slots = 4});
  }
};

/* ---- The stream ------------------------------------------------------------------------------ */

TEST_F(Tracing, LaysTheStreamOutAsConfigured) {
  host::configureTracing({.slots = 64, .enabled = false, .throttling = false, .notify = false});
  EXPECT_EQ(stream().mask, 63u);
  EXPECT_EQ(stream().flags | stream().throttling | stream().notifyHandle, 0u);
  host::setTraceEnabled(true);
  host::setTraceThrottling(true);
  EXPECT_EQ(stream().flags, TRACE_STREAM_ENABLED);
  EXPECT_NE(stream().throttling, 0u);
  for (const uint32_t slots : {0, 100}) {
    EXPECT_THROW(host::configureTracing({.slots = slots}), std::invalid_argument);
  }
}

TEST_F(Tracing, ReadsEveryFieldBack) {
  clockNanoseconds = 123'456'789;
  write();
  finishRecord(beginRecord(0x2aaa, 0x5555, TRACE_RECORD_THROTTLE));
  EXPECT_THAT(host::readTrace(),
              ElementsAre(_, FieldsAre(1, TRACE_RECORD_THROTTLE, 0x2aaa, 0x5555, 0xc3, 123'456'789,
                                       ElementsAre(100, 101, 102, 103, 104, 105))));
}

TEST_F(Tracing, ReadsTheLastLapInOrderWithoutWhatIsUnfinished) {
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
  std::atomic_ref(stream().sequence).fetch_add(1); /* claimed; the slot still holds 6 */
  EXPECT_THAT(sequencesRead(), ElementsAre(7, 8, 9));
}

/* Each record's payload follows from its sequence number, so a torn copy shows. The reader races
 * one emitter through as many laps as fit into its own reads. */
TEST_F(Tracing, ReadsNoTornRecordWhileEmittersRun) {
  host::configureTracing({.slots = 2});
  std::atomic<bool> stop{false};
  std::thread emitter([&] {
    while (!stop) write();
  });
  size_t torn = 0;
  for (uint64_t seen = 0, last = 0; seen < 100'000;) {
    for (const host::TracedRecord &record : host::readTrace()) {
      seen += record.sequence > last; /* only what the emitter wrote meanwhile */
      last = std::max(last, record.sequence);
      for (uint64_t i = 0; i < 6; ++i) torn += record.payload[i] != record.sequence * (100 + i);
    }
  }
  stop = true;
  emitter.join();
  EXPECT_EQ(torn, 0u);
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
  const auto after = std::chrono::system_clock::now().time_since_epoch().count();
  const auto entries = host::wallClockEntries();
  ASSERT_EQ(entries.size(), 256u);
  EXPECT_THAT(entries.front(), FieldsAre(start + 744, 5000, Ge(before)));
  EXPECT_THAT(entries.back(), FieldsAre(start + 999, 5000, Le(after)));
}

TEST_F(Tracing, ConfiguringStartsOver) {
  write();
  Trace_CreateWallClockEntry(&stream(), &slot(0));
  Trace_Notify(stream().notifyHandle);
  Trace_Notify(stream().notifyHandle + 1); /* nobody's */
  EXPECT_EQ(host::traceNotifications(), 1u);
  host::configureTracing({});
  EXPECT_EQ(host::readTrace().size() + host::wallClockEntries().size(), 0u);
  EXPECT_EQ(host::traceNotifications(), 0u);
}

TEST_F(Tracing, LevelsAreSetClassByClassAndNoticeIdsFitTheirField) {
  host::configureTracing({.classLevel = 2});
  host::setTraceClassLevel(36, 0);
  EXPECT_EQ(Trace_ClassLevelGet(35), 2);
  EXPECT_EQ(Trace_ClassLevelGet(36), 0);
  host::setTraceClassLevel(64, 2);
  EXPECT_LT(Trace_ClassLevelGet(64), 0); /* no such class: below any event */
  EXPECT_NE(Trace_GetPerTraceThrottledTraceId(), Trace_GetGlobalThrottledTraceId());
  EXPECT_LT(Trace_GetPerTraceThrottledTraceId(), 1u << 14);
  EXPECT_LT(Trace_GetGlobalThrottledTraceId(), 1u << 14);
}

/* ---- Buckets --------------------------------------------------------------------------------- */

class Buckets : public Tracing, public WithParamInterface<const char *> {
 protected:
  Buckets() { start(4, 4); }
  ~Buckets() override { tick = 1; }

  /* A full bucket at the clock's zero; the other kind keeps another rate. */
  void start(uint64_t burst, uint64_t perSecond) {
    clockNanoseconds = 0;
    host::TraceSettings settings;
    (isSmall_ ? settings.perEventBurst : settings.globalBurst) = burst;
    (isSmall_ ? settings.perEventPerSecond : settings.globalPerSecond) = perSecond;
    host::configureTracing(settings);
    TokenBucket_InitMini(&small_, perTraceTbConfig);
  }
  /* Tokens left when `tokens` were granted; -1 - tokens left when they were refused. */
  int64_t use(uint64_t tokens = 1) {
    uint64_t left = 0xdead;
    const bool granted = isSmall_
                             ? TokenBucket_UseTokensMini(&small_, perTraceTbConfig, tokens, &left)
                             : TokenBucket_UseTokens(&stream().globalBucket, tokens, &left);
    return granted ? static_cast<int64_t>(left) : -1 - static_cast<int64_t>(left);
  }
  uint64_t wait() {
    if (isSmall_) return TokenBucket_TimeToGetTokens(&small_);
    return TokenBucket_TimeToGetTokens(&stream().globalBucket);
  }

  TokenBucketMini small_{};
  const bool isSmall_ = GetParam() == std::string_view("Small");
};
INSTANTIATE_TEST_SUITE_P(, Buckets, Values("Small", "Global"),
                         [](const auto &kind) { return kind.param; });

TEST_P(Buckets, GrantTheBurstThenRefuseAndTellWhatIsLeft) {
  EXPECT_EQ(wait(), 0u);
  EXPECT_EQ(use(UINT64_MAX), -1 - 4);
  EXPECT_EQ(use(), 3);
  EXPECT_EQ(use(2), 1);
  EXPECT_EQ(use(2), -1 - 1); /* refused: the token left stays */
  EXPECT_EQ(use(), 0);
  EXPECT_EQ(use(), -1 - 0);
}

TEST_P(Buckets, GrantOneTokenAnIntervalUpToTheBurst) {
  EXPECT_EQ(use(4), 0);
  EXPECT_EQ(wait(), kSecond / 4);
  clockNanoseconds += kSecond / 4 - 1;
  EXPECT_EQ(wait(), 1u);
  EXPECT_EQ(use(), -1);
  clockNanoseconds += 1 + kSecond / 8; /* one and a half; the half is kept */
  EXPECT_EQ(wait(), 0u);
  EXPECT_EQ(use(), 0);
  EXPECT_EQ(use(), -1);
  clockNanoseconds += kSecond / 8;
  EXPECT_EQ(use(), 0);
  clockNanoseconds += 1000 * kSecond;
  EXPECT_EQ(use(5), -1 - 4);
}

/* In one second, asked all the time: its rate's tokens, whether a tick's fill the bucket or not. */
TEST_P(Buckets, LoseNoTokenBetweenTicks) {
  tick = 4'000'000;
  const auto granted = [&](uint64_t burst, uint64_t perSecond) {
    start(burst, perSecond);
    use(burst);
    int count = 0;
    for (; clockNanoseconds < kSecond; clockNanoseconds += 10'000) count += use() >= 0;
    return count;
  };
  EXPECT_EQ(granted(1, 10'000), 9'999);
  EXPECT_EQ(granted(8, 2'000), 1'992); /* the second's last tick brings its tokens to the next */
  EXPECT_EQ(granted(64, 50), 49);
}

TEST_P(Buckets, KeepToTheirExtremes) {
  small_ = {}; /* that nobody filled: gathers from the clock's zero on */
  EXPECT_GT(TokenBucket_TimeToGetTokens(&small_), 0u);
  clockNanoseconds = 60 * kSecond;
  EXPECT_EQ(TokenBucket_TimeToGetTokens(&small_), 0u);
  start(4, 0); /* no refill: the burst once */
  EXPECT_EQ(use(4), 0);
  clockNanoseconds += 1000 * kSecond;
  EXPECT_EQ(use(), -1);
  EXPECT_EQ(wait(), UINT64_MAX);
  start(0, 4); /* no burst: nothing ever */
  EXPECT_EQ(use(), -1);
  EXPECT_EQ(wait(), UINT64_MAX);
  start(UINT64_MAX, 4); /* no overflow */
  EXPECT_LT(use(UINT64_MAX), 0);
  EXPECT_GT(use(), 1'000'000);
}

TEST_P(Buckets, GrantEachTokenToOneThread) {
  constexpr int kTokens = 1'000'000;
  start(kTokens, 0);
  std::atomic<int> granted{0};
  const auto taker = [&] {
    int mine = 0;
    for (int i = 0; i < kTokens; ++i) mine += use() >= 0;
    granted += mine;
  };
  std::thread one(taker);
  std::thread two(taker);
  one.join();
  two.join();
  EXPECT_EQ(granted, kTokens);
}

}  // namespace
