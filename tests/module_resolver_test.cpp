/* What is not seen by comparing what the module holds, step by step, with what it should hold: the
 * order of its calls, lines that no failure makes, slots, arguments, every byte of a read-out,
 * callbacks that tell nothing new, and events that come too late. */
#include <cstring>

#include "tests/module_fixture.h"

using sim::Call;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

constexpr uint32_t RESOLVED = KARST_RESOLVER_STATE_RESOLVED;
constexpr uint32_t UNRESOLVED = KARST_RESOLVER_STATE_UNRESOLVED;
using Lines = std::vector<std::string>;

class Resolver : public ModuleTest {
 protected:
  void startWith(uint32_t nodes) {
    for (uint32_t n = 1; n <= nodes; n++) putSimpleNode(n);
    start();
    traced();
  }
  /* A call of a subscription that was under way when what it is about went. */
  void tellLate(const char *callback, void *data, const zel_UUID &uuid, zel_Status status) {
    using Told = zel_Status(void *, const KarstEntryHeader *, void *, zel_Status);
    KarstEntryHeader header{};
    header.uuid = uuid;
    header.owner = nodeUUID(2);
    sim.call("directory", [&] { internal<Told>(callback)(data, &header, nullptr, status); });
  }
  size_t blocks() { return host::heapState(host::heapsAlive().at(0)).blocks.size(); }
};

TEST_F(Resolver, CallsThePlatformInOrder) {
  putSimpleNode(2);
  ASSERT_EQ(load(), "");
  directory().setSelf(nodeUUID(1));
  /* nodes, interfaces, and the world's: a health */
  const Lines enabling = {"KARST_GetSelfUUID", "TOLM_WorldCreate", "KARST_Subscribe",
                          "KARST_Subscribe", "KARST_Subscribe"};
  const Lines disabling = {"TOLM_WorldDestroy", "KARST_Unsubscribe", "KARST_Unsubscribe",
                           "KARST_Unsubscribe"};
  Lines either = enabling;
  either.insert(either.end(), disabling.begin(), disabling.end());
  for (const bool usable : {true, false, true, false}) {
    sim.clearHistory();
    directory().setUsable(usable);
    sim.run();
    EXPECT_EQ(calls(either), usable ? enabling : disabling);
  }
}

/* ---- Nodes, interfaces, locators ------------------------------------------------------------- */

TEST_F(Resolver, SlotsOfNodesAreUsedAgainFirstAndOfInterfacesLast) {
  startWith(2);
  KARSTResolverNode *node = cachedNode(2);
  KARSTResolverNetIf *gone = cachedNetIfs().at(1);
  sim.hold("karst-delivery");
  putHealth(2, 9);
  tellLate("KARSTResolverNetIfSubCbk", cache(), netIfUUID(2), ZEL_NOT_FOUND);
  EXPECT_EQ(gone->refCount, 1u) << "the health subscription's, until its last call";
  tellLate("KARSTResolverNetIfHealthSubCbk", gone, netIfUUID(2), ZEL_OK); /* late: nothing */
  EXPECT_EQ(gone->node, nullptr);
  sim.release("karst-delivery");
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  sim.run();
  EXPECT_EQ(std::memcmp(gone->tag, "\x94\x9e\x8d\x8c\x8b\x8d\x91\x96", 8), 0);
  EXPECT_EQ(std::memcmp(node->tag, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8), 0);
  EXPECT_EQ(cache()->freeNetIfs.previous, &gone->freeLinks);
  EXPECT_EQ(cache()->freeNodes.next, &node->freeLinks);
}

TEST_F(Resolver, NodeWithoutASlotComesAndGoesUnseen) {
  for (uint32_t n = 1; n <= KARST_RESOLVER_NODE_POOL_SIZE + 1; n++) putNode(n);
  start();
  directory().remove(KARST_TYPE_NODE, nodeUUID(7));
  sim.run();
  traced();
  directory().remove(KARST_TYPE_NODE, nodeUUID(KARST_RESOLVER_NODE_POOL_SIZE + 1));
  sim.run();
  EXPECT_THAT(traced(), IsEmpty()) << "not even a slot is taken for the moment";
}

TEST_F(Resolver, ReportsOwnersThatChangedMeanwhileAndUnknownNetworks) {
  const std::string owner =
      "2 KARSTResolver: KARSTResolverUpdateNetIf:N: Netif owner changed to "
      "a0000000-0000-0000-0000-000000000003";
  const std::string unknown =
      "1 KARSTResolver: KARSTResolverGenerateNodeLocators:N: Unknown network type 7 for interface "
      "b0000000-0000-0000-0000-000000000009";
  startWith(3);
  sim.hold("karst-delivery"); /* the entry moves on before its first event is looked at */
  putNetIf(4, 2, {"10.0.0.4"});
  putNetIf(4, 3, {"10.0.0.4"});
  sim.release("karst-delivery");
  sim.run();
  EXPECT_THAT(log, ElementsAre(owner));

  KarstNetInterfaceEntry single = netIfRecord({}), odd = netIfRecord({"10.0.0.9"});
  single.ipv4Address[0] = 192;
  odd.networkType = 7;
  putNetIf(2, 2, {"10.0.0.1", "fd00::2", "10.0.0.3"});
  for (uint32_t n : {8, 9}) putHealth(n, 0);
  putNetIf(8, 2, single);
  sim.run();
  EXPECT_THAT(textsOf(cachedNode(2)->locators),
              ElementsAre("10.0.0.1", "fd00::2", "10.0.0.3", "192.0.0.0"));
  putNetIf(9, 2, odd);
  sim.run();
  EXPECT_THAT(log, ElementsAre(owner)) << "nobody looks behind the fourth locator";
  putHealth(8, 1);
  sim.run();
  EXPECT_THAT(log, ElementsAre(owner, unknown));
}

/* ---- Clients --------------------------------------------------------------------------------- */

TEST_F(Resolver, CreateSaysWhyItFails) {
  putObject(1, 2);
  startWith(2);
  const size_t before = blocks();
  Client client;
  const auto withoutResult = [&] { return create_(nullptr, 0, noUUID, nodeUUID(1), false); };
  EXPECT_EQ(sim.call("client", withoutResult), ZEL_BAD_PARAM);
  EXPECT_EQ(create(client, noUUID, noUUID), ZEL_BAD_PARAM);

  /* While init_module still runs, another module's thread may come early. */
  auto **cachePointer =
      static_cast<KARSTResolverCache **>(module().anySymbol("karstResolverCache"));
  KARSTResolverCache *kept = std::exchange(*cachePointer, nullptr);
  EXPECT_EQ(createForNode(client, 1), ZEL_NOT_INITIALIZED);
  *cachePointer = kept;

  /* Whatever the platform's status is, known or not. */
  sim.failAt(Call::zel_SpinlockCreate, 1, 1, 0x0bad0777);
  EXPECT_EQ(createForNode(client, 2), 0x0bad0777u);
  EXPECT_THAT(traced(), IsEmpty()) << "an instance without a lock never was";
  sim.failAt(Call::KARST_Subscribe, 1, 1, 0x0bad0778);
  EXPECT_EQ(createForObject(client, 1), 0x0bad0778u);
  EXPECT_EQ(client.instance, nullptr);
  EXPECT_EQ(blocks(), before);
}

TEST_F(Resolver, ReadOutWritesWhatItSaysAndNothingElse) {
  startWith(2);
  putNode(2, 8, 4);
  putNetIf(2, 2, {"10.0.0.2", "fd00::2", "10.0.0.22"});
  sim.run();
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  std::vector<uint8_t> bytes, before;
  const auto readWith = [&](uint16_t capacity) {
    before.assign(KARSTResolverNodeLocatorsSize(9) + 8, 0xee);
    std::memcpy(&before[offsetof(KARSTResolverNodeLocators, capacity)], &capacity, sizeof capacity);
    bytes = before;
    return read(client, reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data()));
  };
  const auto same = [&](size_t from, size_t to) {
    return std::memcmp(&bytes[from], &before[from], to - from) == 0;
  };
  for (const uint16_t capacity : {0, 1, 2, 3, 4, 9}) {
    SCOPED_TRACE(capacity);
    ASSERT_EQ(readWith(capacity), ZEL_OK);
    const auto &set = *reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data());
    EXPECT_EQ(set.nodeUUID, nodeUUID(2));
    EXPECT_THAT((std::array<uint64_t, 5>{set.majorVersion, set.minorVersion, set.trafficType,
                                         set.capacity, set.count}),
                ElementsAre(8, 4, 0, capacity, std::min<uint16_t>(capacity, 3)));
    Lines expected = {"10.0.0.2", "fd00::2", "10.0.0.22"};
    expected.resize(set.count);
    EXPECT_EQ(textsOf(set), expected);
    EXPECT_TRUE(same(24, 40));
    EXPECT_TRUE(same(KARSTResolverNodeLocatorsSize(set.count), bytes.size()));
  }
  putHealth(2, 1);
  sim.run();
  EXPECT_EQ(readWith(4), ZEL_NOT_FOUND);
  EXPECT_EQ(bytes, before);
  destroy(client);
}

TEST_F(Resolver, CallbackComesAtOnceAndAtEveryRefresh) {
  startWith(3);
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  setCallback(client);
  for (const uint32_t health : {1, 0}) {
    putHealth(2, health);
    sim.run();
  }
  putNetIf(2, 2, {"10.0.0.2"}, 0x5); /* another record, the same answer */
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED, RESOLVED, RESOLVED));
  EXPECT_THAT(client.counts, ElementsAre(1, 0, 1, 1));
  removeCallback(client);
  putHealth(2, 1);
  sim.run();
  EXPECT_EQ(client.states.size(), 4u);
  destroy(client);
}

TEST_F(Resolver, CallsForADestroyedInstanceDoNothing) {
  putObject(1, 2);
  startWith(3);
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  sim.hold("karst-delivery");
  KARSTResolverInstance *instance = client.instance;
  traced();
  destroy(client);
  EXPECT_EQ(instance->refCount, 1u) << "the object's last call is due";
  tellLate("KARSTResolverObjectSubCbk", instance, objectUUID(1), ZEL_OK);
  auto *track = internal<void(KARSTResolverInstance *, zel_UUID)>("KARSTResolverTrackNode");
  sim.call("directory", [&] { track(instance, nodeUUID(2)); }); /* had looked before the destroy */
  client.instance = instance;
  setCallback(client); /* nothing is installed, nobody is called */
  EXPECT_THAT(client.states, IsEmpty());
  sim.release("karst-delivery");
  sim.run();
  std::vector<uint32_t> events;
  for (const host::TracedRecord &record : traced()) events.push_back(record.id);
  EXPECT_THAT(events, ElementsAre(2, 18, 18)) << "destroyed, and released twice";
}

}  // namespace
