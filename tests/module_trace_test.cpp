/* Trace emission: selection, throttling with its notices, the record, wall-clock entries. The
 * events themselves are asserted where they happen, in the other module tests. */
#include "tests/module_fixture.h"

using sim::Call;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

constexpr uint32_t SET_CALLBACK = 17, INVOKE_CALLBACK = 7;

class Trace : public ModuleTest {
 protected:
  static sim::Settings throttled(uint64_t perEvent, uint64_t global) {
    sim::Settings settings = defaults();
    settings.tracing.throttling = true;
    settings.tracing.perEventBurst = perEvent;
    settings.tracing.globalBurst = global;
    settings.tracing.perEventPerSecond = 1;
    settings.tracing.globalPerSecond = 1;
    return settings;
  }
  explicit Trace(const sim::Settings &settings = defaults()) : ModuleTest(settings) {}

  void SetUp() override {
    host::setTraceThrottling(false);
    putSimpleNode(1);
    start();
    ASSERT_EQ(createForNode(client_, 1), ZEL_OK);
    traced();
    host::setTraceThrottling(sim.settings().tracing.throttling);
  }
  void TearDown() override { destroy(client_); }

  /* Emits SetCallback `times` times and nothing else. */
  void emit(unsigned times = 1) {
    for (unsigned i = 0; i < times; i++) removeCallback(client_);
  }
  uint64_t perEventUses() { return sim.uses(Call::TokenBucket_UseTokensMini); }
  uint64_t globalUses() { return sim.uses(Call::TokenBucket_UseTokens); }

  Client client_;
};

TEST_F(Trace, ClassLevelSelects) {
  host::setTraceThrottling(true);
  host::setTraceClassLevel(37, 1);
  emit();
  EXPECT_THAT(traced(), IsEmpty());
  EXPECT_EQ(perEventUses() + globalUses(), 0u) << "an event that is not selected asks no bucket";
  host::setTraceClassLevel(37, 2);
  emit();
  EXPECT_EQ(traced().size(), 1u);
  host::setTraceClassLevel(37, 0);
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(1));
  directory().remove(KARST_TYPE_NODE, nodeUUID(1));
  sim.run();
  removeCallback(client_);
  traced();
  destroy(client_);
  EXPECT_THAT(tracedIds(), ElementsAre(13)) << "a node that leaves is written at level 0";
  client_ = Client{};
  putSimpleNode(1);
  sim.run();
  ASSERT_EQ(createForNode(client_, 1), ZEL_OK);
}

TEST_F(Trace, DisabledStreamAsksNoBucket) {
  host::setTraceThrottling(true);
  host::setTraceEnabled(false);
  emit();
  EXPECT_EQ(perEventUses() + globalUses(), 0u);
  host::setTraceEnabled(true);
  EXPECT_THAT(traced(), IsEmpty());
}

TEST_F(Trace, UnthrottledWritesEverything) {
  emit(500);
  EXPECT_EQ(traced({SET_CALLBACK}).size(), 500u);
  EXPECT_EQ(perEventUses() + globalUses(), 0u);
}

TEST_F(Trace, RecordCarriesItsFields) {
  sim.advance(std::chrono::nanoseconds(12345));
  auto before = static_cast<uint64_t>(sim.now().count());
  setCallback(client_);
  auto records = traced();
  ASSERT_EQ(records.size(), 2u);
  EXPECT_EQ(records[1].sequence, records[0].sequence + 1);
  EXPECT_EQ(records[0].type, 8u);
  EXPECT_EQ(records[0].id, SET_CALLBACK);
  EXPECT_EQ(records[0].site, 621u);
  EXPECT_GE(records[0].timeNanoseconds, before);
  EXPECT_LE(records[0].timeNanoseconds, static_cast<uint64_t>(sim.now().count()));
  auto instance = reinterpret_cast<uint64_t>(client_.instance);
  EXPECT_EQ(records[0].payload[0], instance);
  EXPECT_EQ(records[0].payload[2], reinterpret_cast<uint64_t>(&client_));
  EXPECT_EQ(records[1].id, INVOKE_CALLBACK);
  EXPECT_EQ(records[1].site, 39u);
  EXPECT_THAT(records[1].payload,
              ElementsAre(instance, objectType, 0, 0, records[0].payload[1], 1));
  removeCallback(client_);
}

/* The bits of the ring itself, without the library's reader: phase by lap, sequence, site. */
TEST_F(Trace, RingHoldsTheFixedLayoutOverLaps) {
  host::TraceSettings settings;
  settings.slots = 8;
  settings.classLevel = 2;
  settings.throttling = false;
  host::configureTracing(settings);
  auto *stream = static_cast<TraceStream *>(traceStreamTables[1]);
  auto *ring = reinterpret_cast<TraceRecord *>(reinterpret_cast<uint8_t *>(stream) + 128);
  for (uint64_t sequence = 0; sequence < 40; sequence++) {
    emit();
    const TraceRecord &record = ring[sequence & 7];
    EXPECT_EQ(record.word0 & 1, 1 - ((sequence >> stream->lapShift) & 1));
    EXPECT_EQ(record.word1 & 0x3f, 8u);
    EXPECT_EQ(record.word1 >> 6 & 0x3fff, SET_CALLBACK);
    EXPECT_EQ(record.word1 >> 20 & 0x7fff, 621u);
    EXPECT_EQ(record.word1 >> 35, sequence);
    EXPECT_THAT((std::array<uint64_t, 3>{record.payload[3], record.payload[4], record.payload[5]}),
                Each(0));
  }
  host::configureTracing(sim.settings().tracing);
}

TEST_F(Trace, WallClockAndNotificationComeAtTheirIntervals) {
  host::configureTracing(sim.settings().tracing);
  uint64_t wallClocks = sim.uses(Call::Trace_CreateWallClockEntry);
  uint64_t notifications = sim.uses(Call::Trace_Notify);
  emit(2049); /* sequence numbers 0 to 2048 */
  EXPECT_EQ(sim.uses(Call::Trace_CreateWallClockEntry) - wallClocks, 2u);
  EXPECT_EQ(sim.uses(Call::Trace_Notify) - notifications, 5u);
  EXPECT_THAT(host::wallClockEntries(), ::testing::SizeIs(2));
  auto *stream = static_cast<TraceStream *>(traceStreamTables[1]);
  stream->notifyHandle = 0;
  emit(2048);
  EXPECT_EQ(sim.uses(Call::Trace_Notify) - notifications, 5u) << "nobody to tell";
  host::configureTracing(sim.settings().tracing);
}

struct PerEventThrottle : Trace {
  PerEventThrottle() : Trace(throttled(3, 1000)) {}
};

TEST_F(PerEventThrottle, LastTokenWritesANoticeThenSilence) {
  emit(2);
  EXPECT_EQ(traced({SET_CALLBACK}).size(), 2u);
  emit(); /* takes the last token */
  auto notice = traced();
  ASSERT_EQ(notice.size(), 1u);
  EXPECT_EQ(notice[0].type, 9u);
  EXPECT_EQ(notice[0].site, 407u);
  EXPECT_EQ(notice[0].id, Trace_GetPerTraceThrottledTraceId());
  EXPECT_GT(notice[0].payload[0], 0u) << "nanoseconds until there is a token";
  EXPECT_LE(notice[0].payload[0], 1'000'000'000u);
  EXPECT_EQ(notice[0].payload[1], SET_CALLBACK * 64 + 8);
  EXPECT_THAT((std::array<uint64_t, 4>{notice[0].payload[2], notice[0].payload[3],
                                       notice[0].payload[4], notice[0].payload[5]}),
              Each(0));
  uint64_t global = globalUses();
  emit(10);
  EXPECT_THAT(traced(), IsEmpty());
  EXPECT_EQ(globalUses(), global) << "a refused event leaves the global bucket alone";
  sim.advance(std::chrono::seconds(3));
  emit(2);
  EXPECT_EQ(traced({SET_CALLBACK}).size(), 2u);
}

struct GlobalThrottle : Trace {
  GlobalThrottle() : Trace(throttled(1000, 3)) {}
};

TEST_F(GlobalThrottle, LastTokenOfTheStreamWritesAGlobalNotice) {
  emit(5);
  auto records = traced();
  ASSERT_EQ(records.size(), 3u);
  EXPECT_EQ(records[1].type, 8u);
  EXPECT_EQ(records[2].type, 9u);
  EXPECT_EQ(records[2].site, 430u);
  EXPECT_EQ(records[2].id, Trace_GetGlobalThrottledTraceId());
  EXPECT_GT(records[2].payload[0], 0u);
  EXPECT_EQ(records[2].payload[1], 0u);
}

struct BothThrottles : Trace {
  BothThrottles() : Trace(throttled(2, 2)) {}
};

TEST_F(BothThrottles, GlobalNoticeWins) {
  emit(2);
  auto records = traced();
  ASSERT_EQ(records.size(), 2u);
  EXPECT_EQ(records[1].site, 430u);
  EXPECT_EQ(records[1].payload[1], 0u);
}

}  // namespace
