/* Trace emission: every event with its arguments, selection, throttling with its notices, the ring's
 * laps, wall-clock entries. */
#include <map>

#include "host/kernel/text.h"
#include "tests/module_fixture.h"

using sim::Call;
using ::testing::_;
using ::testing::ElementsAre;
using ::testing::Field;
using ::testing::SizeIs;
using ::testing::StartsWith;

namespace {

constexpr uint32_t SET_CALLBACK = 17, RELEASE = 18;

class Trace : public ModuleTest {
 protected:
  void SetUp() override {
    putSimpleNode(1);
    start();
    ASSERT_EQ(create(client_, noUUID, nodeUUID(1)), ZEL_OK);
    traced();
  }
  void TearDown() override { destroy(client_); }

  /* Emits SetCallback `times` times and nothing else. */
  void emit(unsigned times = 1) {
    for (unsigned i = 0; i < times; i++) setCallback(client_, false);
  }

  Client client_;
};

/* ---- The events ------------------------------------------------------------------------------ */

/* "id @site" and the payload up to its last word that is not 0. Addresses go by the
 * order of their appearance, UUIDs as "node #1". */
class Text {
 public:
  std::string of(const host::TracedRecord &record) {
    std::string text = host::formatText("%u @%u", record.id, record.site);
    size_t words = record.id == RELEASE ? 2 : std::size(record.payload);
    while (words > 0 && record.payload[words - 1] == 0) --words;
    for (size_t i = 0; i < words; i++) text += " " + wordOf(record.payload[i]);
    return text;
  }

 private:
  std::string wordOf(uint64_t word) {
    if (word << 8 == 0 && word != 0) return host::formatText("#%u", unsigned(word >> 56));
    if (known_.count(word) == 0 && word < 0x10000) return std::to_string(word);
    return known_.try_emplace(word, "p" + std::to_string(known_.size() - 2)).first->second;
  }
  /* The kinds of UUIDs by their first byte, and the addresses. */
  std::map<uint64_t, std::string> known_{{0xa0, "node"}, {0xb0, "netif"}, {0xc0, "object"}};
};

class Events : public ModuleTest {};

TEST_F(Events, SayWhatHappened) {
  putNode(1);
  putNode(2);
  putHealth(2, 0, 33);
  putNetIf(2, 2, {"10.0.0.1", "10.0.0.2"});
  putObject(1, 2);
  start();
  Client client;
  ASSERT_EQ(create(client, objectUUID(1), noUUID), ZEL_OK);
  setCallback(client);
  putHealth(2, 5, 77);
  sim.run();
  directory().remove(objectType, objectUUID(1));
  sim.run();
  destroy(client);
  directory().resync();
  sim.run();
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(2));
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  sim.run();
  Text text;
  std::vector<std::string> texts, releasedFrom;
  for (const host::TracedRecord &record : traced()) {
    texts.push_back(text.of(record));
    if (record.id != RELEASE) continue;
    releasedFrom.push_back(host::symbolize(reinterpret_cast<void *>(record.payload[2])));
    EXPECT_NE(record.payload[3], 0u) << "who called that";
  }
  const std::vector<std::string> expected = {
      "12 @454 p1 node #1 1",
      "14 @50 p1 node #1 1",
      "12 @454 p2 node #2",
      "8 @150 p3 netif #2 node #2",
      "10 @304 p3 netif #2 node #2",
      "14 @50 p2 node #2 1",
      "14 @578 p1 node #1 1",
      "14 @578 p2 node #2 1 2",
      /* the client comes */
      "1 @485 p4 20 object #1",
      "4 @315 p4 20 object #1",
      "3 @220 p4 20 object #1 node #2",
      "6 @120 p4 object #1 node #2 2",
      "4 @315 p4 20 object #1 node #2",
      "17 @621 p4 p5 p6",
      "7 @39 p4 20 object #1 p5 2",
      /* the interface fails */
      "11 @378 p3 netif #2 0 5 77",
      "14 @578 p2 node #2 1",
      "6 @120 p4 object #1",
      "7 @39 p4 20 object #1 p5",
      "18 @384 p4 3",
      /* the object goes */
      "5 @330 p4 20 object #1 node #2",
      "3 @220 p4 20 object #1",
      "6 @120 p4 object #1",
      "7 @39 p4 20 object #1 p5",
      /* the client goes */
      "2 @547 p4 20 object #1",
      "18 @384 p4 2",
      "18 @384 p4 1",
      /* the directory starts over, and node 2 goes */
      "16 @230",
      "15 @414",
      "9 @195 p3 netif #2 node #2",
      "14 @50 p2 node #2",
      "13 @453 p2 node #2",
  };
  EXPECT_EQ(texts, expected);
  EXPECT_THAT(releasedFrom, ElementsAre(_, StartsWith("KARSTResolver_Destroy"),
                                        StartsWith("KARSTResolverObjectSubCbk")));
}

/* ---- Selection ------------------------------------------------------------------------------- */

TEST_F(Trace, IsSelectedByClassLevelAndSwitch) {
  const struct {
    bool enabled;
    int32_t level;
    uint64_t written;
  } rows[] = {{true, 1, 0} /* an event of level 2 */, {false, 2, 0}, {true, 2, 1}};
  for (const auto &row : rows) {
    host::setTraceEnabled(row.enabled);
    host::setTraceClassLevel(37, row.level);
    emit();
    EXPECT_THAT(traced(), SizeIs(row.written)) << "class level " << row.level;
  }
  for (const uint32_t traceClass : {35, 36, 37}) host::setTraceClassLevel(traceClass, 0);
  putNode(2);
  sim.run();
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  sim.run();
  EXPECT_THAT(traced(), ElementsAre(Field(&host::TracedRecord::id, 13))) << "of level 0 alone";
}

/* ---- Throttling ------------------------------------------------------------------------------ */

TEST_F(Trace, SaysOnceThatABucketRunsDry) {
  const uint64_t kind = SET_CALLBACK * 64 + 8;
  const struct {
    uint64_t perEvent, global;
    std::vector<uint32_t> sites; /* of the records */
    uint64_t suppressed;         /* as the last one says */
    uint64_t globalAsked;
  } rows[] = {
      {3, 1000, {621, 621, 407}, kind, 3},
      {1000, 3, {621, 621, 430}, 0, 10},
      {2, 2, {621, 430}, 0, 2}, /* both: the stream's counts */
  };
  for (const auto &row : rows) {
    SCOPED_TRACE(row.perEvent);
    host::TraceSettings settings = sim.settings().tracing;
    settings.throttling = true;
    settings.perEventBurst = row.perEvent;
    settings.globalBurst = row.global;
    settings.perEventPerSecond = settings.globalPerSecond = 1;
    host::configureTracing(settings);
    internal<void()>("KARSTResolverTraceInit")(); /* fills the event's bucket */
    const uint64_t asked = sim.uses(Call::TokenBucket_UseTokens);
    emit(10);
    const std::vector<host::TracedRecord> records = host::readTrace();
    std::vector<uint32_t> sites;
    for (const host::TracedRecord &record : records) sites.push_back(record.site);
    EXPECT_EQ(sites, row.sites);
    EXPECT_EQ(sim.uses(Call::TokenBucket_UseTokens) - asked, row.globalAsked);
    const host::TracedRecord &notice = records.back();
    EXPECT_EQ(notice.type, 9u);
    EXPECT_EQ(notice.id, row.suppressed ? Trace_GetPerTraceThrottledTraceId()
                                        : Trace_GetGlobalThrottledTraceId());
    EXPECT_GT(notice.payload[0], 0u) << "nanoseconds until there is a token";
    EXPECT_THAT(std::vector(notice.payload + 1, std::end(notice.payload)),
                ElementsAre(row.suppressed, 0, 0, 0, 0));
  }
}

/* ---- The ring -------------------------------------------------------------------------------- */

TEST_F(Trace, KeepsTheLastLapAndTellsAtItsIntervals) {
  host::TraceSettings settings = sim.settings().tracing;
  settings.slots = 8;
  host::configureTracing(settings);
  const uint64_t notifications = sim.uses(Call::Trace_Notify);
  emit(2049); /* sequence numbers 0 to 2048 */
  EXPECT_THAT(host::wallClockEntries(), SizeIs(2));
  EXPECT_EQ(sim.uses(Call::Trace_Notify) - notifications, 5u);
  static_cast<TraceStream *>(traceStreamTables[1])->notifyHandle = 0;
  emit(2052); /* into the next lap, whose phase is another one */
  EXPECT_EQ(sim.uses(Call::Trace_Notify) - notifications, 5u) << "nobody to tell";
  std::vector<uint64_t> sequences;
  for (const host::TracedRecord &record : host::readTrace()) sequences.push_back(record.sequence);
  EXPECT_THAT(sequences, ElementsAre(4093, 4094, 4095, 4096, 4097, 4098, 4099, 4100));
  host::configureTracing(sim.settings().tracing);
}

}  // namespace
