/* What is not seen by comparing what the module holds, step by step, with what it should hold: the
 * order of its calls, lines that no failure makes, slots, arguments, every byte of a read-out, the
 * locks of callbacks, and events that come too late. One step at a time on the simulator.
 */
#include <cstring>

#include "tests/module_fixture.h"

using sim::Call;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

constexpr uint32_t RESOLVED = KARST_RESOLVER_STATE_RESOLVED;
constexpr uint32_t UNRESOLVED = KARST_RESOLVER_STATE_UNRESOLVED;
const char *const WORLD = "KARSTResolverCache";

using Told = zel_Status(void *, const KarstEntryHeader *, void *, zel_Status);

class Resolver : public ModuleTest {
 protected:
  void startWith(uint32_t nodes) {
    for (uint32_t n = 1; n <= nodes; n++) putSimpleNode(n);
    start();
    traced();
  }
  KARSTResolverNetIf *netIf(uint32_t number) {
    for (auto *found : cachedNetIfs()) {
      if (found->uuid == netIfUUID(number)) return found;
    }
    return nullptr;
  }
  /* A call of a subscription that was under way when what it is about went. */
  void tellLate(const char *callback, void *data, const KarstEntryHeader &header,
                zel_Status status) {
    sim.call("directory", [&] { internal<Told>(callback)(data, &header, nullptr, status); });
  }
  size_t blocks() { return host::heapState(host::heapsAlive().at(0)).blocks.size(); }
};

/* ---- Enable, disable, unload ----------------------------------------------------------------- */

TEST_F(Resolver, CallsThePlatformInOrder) {
  putSimpleNode(2);
  ASSERT_EQ(load(), "");
  directory().setSelf(nodeUUID(1));
  const std::initializer_list<Call> which = {Call::KARST_GetSelfUUID,
                                             Call::TOLM_WorldCreate,
                                             Call::TOLM_WorldDestroy,
                                             Call::KARST_Subscribe,
                                             Call::KARST_Unsubscribe,
                                             Call::KARST_RegisterStatusCallback,
                                             Call::KARST_DeregisterStatusCallback,
                                             Call::zel_SpinlockDestroy,
                                             Call::zel_HeapDestroy};
  for (int cycle = 0; cycle < 2; cycle++) {
    sim.clearHistory();
    directory().setUsable(true);
    sim.run();
    EXPECT_THAT(calls(which), ElementsAre("KARST_GetSelfUUID", "TOLM_WorldCreate",
                                          "KARST_Subscribe", "KARST_Subscribe", "KARST_Subscribe"))
        << "nodes, interfaces, and the world's: a health";
    EXPECT_EQ(cache()->refCount, 3u);
    sim.clearHistory();
    directory().setUsable(false);
    sim.run();
    EXPECT_THAT(calls(which), ElementsAre("TOLM_WorldDestroy", "KARST_Unsubscribe",
                                          "KARST_Unsubscribe", "KARST_Unsubscribe"));
    EXPECT_EQ(cache()->refCount, 0u);
  }
  sim.clearHistory();
  unload();
  EXPECT_THAT(calls(which), ElementsAre("KARST_DeregisterStatusCallback", "zel_SpinlockDestroy",
                                        "zel_HeapDestroy"));
}

TEST_F(Resolver, UnloadWaitsForLastCallsAndInstances) {
  putObject(1, 1);
  startWith(1);
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.hold("karst-delivery");
  auto unloading = sim.spawn("loader", [&] { unloadHere(); });
  sim.advance(std::chrono::seconds(1));
  EXPECT_FALSE(unloading.ended());
  EXPECT_EQ(cache()->refCount, 4u) << "nodes, interfaces, a health and the instance";
  sim.release("karst-delivery");
  sim.advance(std::chrono::seconds(1));
  EXPECT_FALSE(unloading.ended());
  EXPECT_EQ(cache()->refCount, 1u) << "the instance";

  sim.hold("karst-delivery");
  destroy(client);
  sim.advance(std::chrono::seconds(1));
  EXPECT_FALSE(unloading.ended()) << "the object's last call is due";
  sim.release("karst-delivery");
  sim.finish(unloading);
}

/* ---- Nodes and interfaces -------------------------------------------------------------------- */

TEST_F(Resolver, NodesWithoutASlotComeAndGoUnseen) {
  constexpr uint32_t without = KARST_RESOLVER_NODE_POOL_SIZE + 1;
  for (uint32_t n = 1; n <= without; n++) putNode(n);
  start();
  traced();
  EXPECT_EQ(cachedNodes(), KARST_RESOLVER_NODE_POOL_SIZE);
  putNetIf(1, without, {"10.0.0.1"});
  sim.run();
  directory().remove(KARST_TYPE_NODE, nodeUUID(without));
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(1));
  sim.run();
  EXPECT_THAT(traced(), IsEmpty());
  EXPECT_THAT(log, IsEmpty());
  directory().remove(KARST_TYPE_NODE, nodeUUID(7));
  putNode(without, 99);
  sim.run();
  EXPECT_EQ(cachedNode(without)->majorVersion, 99u);
}

TEST_F(Resolver, SlotsOfNodesAreUsedAgainFirstAndOfInterfacesLast) {
  startWith(2);
  KARSTResolverNode *node = cachedNode(2);
  KARSTResolverNetIf *gone = netIf(2);
  sim.hold("karst-delivery");
  putHealth(2, 9);
  KarstEntryHeader header{};
  header.uuid = netIfUUID(2);
  header.owner = nodeUUID(2);
  tellLate("KARSTResolverNetIfSubCbk", cache(), header, ZEL_NOT_FOUND);
  EXPECT_EQ(netIf(2), nullptr);
  EXPECT_EQ(gone->refCount, 1u) << "the health subscription's, until its last call";
  tellLate("KARSTResolverNetIfHealthSubCbk", gone, header, ZEL_OK); /* late: nothing */
  EXPECT_EQ(gone->node, nullptr);
  sim.release("karst-delivery");
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  sim.run();
  EXPECT_EQ(std::memcmp(gone->tag, "\x94\x9e\x8d\x8c\x8b\x8d\x91\x96", 8), 0);
  EXPECT_EQ(std::memcmp(node->tag, "\x94\x9e\x8d\x8c\x8b\x8d\x91\xff", 8), 0);
  EXPECT_EQ(cache()->freeNetIfs.previous, &gone->freeLinks);
  EXPECT_EQ(cache()->freeNodes.next, &node->freeLinks);
}

/* The entry has moved on before its first event is looked at. */
TEST_F(Resolver, OwnerThatChangedMeanwhileIsReported) {
  putNode(2);
  putNode(3);
  start();
  sim.hold("karst-delivery");
  putNetIf(2, 2, {"10.0.0.2"});
  putNetIf(2, 3, {"10.0.0.2"});
  sim.release("karst-delivery");
  sim.run();
  EXPECT_THAT(log, ElementsAre("2 KARSTResolver: KARSTResolverUpdateNetIf:N: Netif owner changed "
                               "to a0000000-0000-0000-0000-000000000003"));
  ASSERT_EQ(cachedNetIfs().size(), 1u);
  EXPECT_EQ(cachedNetIfs()[0]->node, cachedNode(3));
}

TEST_F(Resolver, HealthIsTracedWithWhatItWas) {
  startWith(2);
  putHealth(2, 5, 77);
  sim.run();
  const auto records = traced({11});
  ASSERT_EQ(records.size(), 1u);
  EXPECT_EQ(records[0].site, 378u);
  EXPECT_THAT(records[0].payload, ElementsAre(reinterpret_cast<uint64_t>(netIf(2)),
                                              KARSTResolverUUIDLow(&netIf(2)->uuid),
                                              KARSTResolverUUIDHigh(&netIf(2)->uuid), 0, 5, 77));
}

/* ---- Locators -------------------------------------------------------------------------------- */

TEST_F(Resolver, NobodyLooksBehindTheFourthLocator) {
  startWith(2);
  const char *const unknown =
      "1 KARSTResolver: KARSTResolverGenerateNodeLocators:N: Unknown network type 7 for interface "
      "b0000000-0000-0000-0000-000000000009";
  KarstNetInterfaceEntry single = netIfRecord({}), odd = netIfRecord({"10.0.0.9"});
  single.ipv4Address[0] = 192;
  odd.networkType = 7;
  putNetIf(2, 2, {"10.0.0.1", "fd00::2", "10.0.0.3"});
  for (uint32_t n : {8, 9}) putHealth(n, 0);
  putNetIf(8, 2, single);
  putNetIf(9, 2, odd);
  sim.run();
  EXPECT_THAT(textsOf(cachedNode(2)->locators),
              ElementsAre("10.0.0.1", "fd00::2", "10.0.0.3", "192.0.0.0"));
  log.clear();
  putHealth(9, 0, 2);
  putNetIf(2, 2, {"10.0.0.4", "fd00::5", "10.0.0.6"});
  sim.run();
  EXPECT_THAT(log, IsEmpty()) << "the single address filled the last place";
  putHealth(8, 1);
  sim.run();
  EXPECT_THAT(log, ElementsAre(unknown));
}

/* ---- Create and read ------------------------------------------------------------------------- */

TEST_F(Resolver, CreateRefusesWhatItCannotServe) {
  startWith(1);
  Client client;
  auto *function = module().function<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
  const auto withoutResult = [&] { return function(nullptr, 0, noUUID, nodeUUID(1), false); };
  EXPECT_EQ(sim.call("client", withoutResult), ZEL_BAD_PARAM);
  EXPECT_EQ(create(client, noUUID, noUUID), ZEL_BAD_PARAM);

  /* While init_module still runs, another module's thread may come early. */
  auto **cachePointer =
      static_cast<KARSTResolverCache **>(module().anySymbol("karstResolverCache"));
  KARSTResolverCache *kept = *cachePointer;
  *cachePointer = nullptr;
  EXPECT_EQ(createForNode(client, 1), ZEL_NOT_INITIALIZED);
  *cachePointer = kept;
  EXPECT_EQ(client.instance, nullptr);
}

/* Whatever the platform's status is, known or not. */
TEST_F(Resolver, CreateFailsWithTheStatusOfWhatFailed) {
  putObject(1, 2);
  startWith(2);
  Client client;
  const size_t before = blocks();
  sim.failAt(Call::zel_SpinlockCreate, 1, 1, 0x0bad0777);
  EXPECT_EQ(createForNode(client, 2), 0x0bad0777u);
  EXPECT_THAT(traced(), IsEmpty()) << "an instance without a lock never was";
  sim.failAt(Call::KARST_Subscribe, 1, 1, 0x0bad0778);
  EXPECT_EQ(createForObject(client, 1), 0x0bad0778u);
  EXPECT_THAT(log,
              ElementsAre("2 KARSTResolver: KARSTResolver_Create:N: Failed to create spinlock: "
                          "unknown status",
                          "1 KARSTResolver: KARSTResolver_Create:N: Failed to install object "
                          "subscription: unknown status"));
  EXPECT_EQ(blocks(), before);
}

TEST_F(Resolver, ReadOutWritesWhatItSaysAndNothingElse) {
  startWith(2);
  putNode(2, 8, 4);
  putNetIf(2, 2, {"10.0.0.2", "fd00::2", "10.0.0.22"});
  sim.run();
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  for (uint16_t capacity : {0, 1, 2, 3, 4, 9}) {
    SCOPED_TRACE(capacity);
    std::vector<uint8_t> bytes(KARSTResolverNodeLocatorsSize(9) + 8, 0xee), before;
    auto *set = reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data());
    set->capacity = capacity;
    before = bytes;
    ASSERT_EQ(read(client, set), ZEL_OK);
    const uint16_t count = std::min<uint16_t>(capacity, 3);
    EXPECT_EQ(set->nodeUUID, nodeUUID(2));
    EXPECT_EQ(set->majorVersion, 8u);
    EXPECT_EQ(set->minorVersion, 4u);
    EXPECT_EQ(set->trafficType, 0u);
    EXPECT_EQ(set->capacity, capacity);
    EXPECT_EQ(set->count, count);
    std::vector<std::string> expected = {"10.0.0.2", "fd00::2", "10.0.0.22"};
    expected.resize(count);
    EXPECT_EQ(textsOf(*set), expected);
    const auto same = [&](size_t from, size_t to) {
      return std::memcmp(&bytes[from], &before[from], to - from) == 0;
    };
    EXPECT_TRUE(same(24, 40));
    EXPECT_TRUE(same(KARSTResolverNodeLocatorsSize(count), bytes.size()));
  }
  putHealth(2, 1);
  sim.run();
  std::vector<uint8_t> bytes(KARSTResolverNodeLocatorsSize(4), 0xee), before = bytes;
  EXPECT_EQ(read(client, reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data())),
            ZEL_NOT_FOUND);
  EXPECT_EQ(bytes, before);
  destroy(client);
}

/* ---- Callbacks ------------------------------------------------------------------------------- */

TEST_F(Resolver, CallbackComesAtOnceAndAtEveryRefreshUnderTheInstancesLockAlone) {
  startWith(3);
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  const auto isHeld = [](KARSTResolverLock lock) {
    return reinterpret_cast<sim::Spinlock *>(lock.handle)->holder != nullptr;
  };
  client.duringCallback = [&]() KARST_UNCHECKED {
    EXPECT_FALSE(isHeld(cache()->lock));
    EXPECT_TRUE(isHeld(client.instance->lock));
  };
  setCallback(client);
  putHealth(2, 1);
  sim.run();
  putHealth(2, 0);
  sim.run();
  putNetIf(2, 2, {"10.0.0.2"}, 0x5); /* another record, the same answer */
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED, RESOLVED, RESOLVED));
  EXPECT_THAT(client.counts, ElementsAre(1, 0, 1, 1));

  auto *refresh = internal<void(KARSTResolverInstance *, KARSTResolverNode *)>(
      "KARSTResolverRefreshNodeLocation");
  sim.call("world", [&] { refresh(client.instance, cachedNode(3)); }); /* not its node any more */
  removeCallback(client);
  putHealth(2, 1);
  sim.run();
  EXPECT_EQ(client.states.size(), 4u);
  destroy(client);
}

TEST_F(Resolver, DestroyWaitsForTheCallbackAndTheWorldFreesTheInstance) {
  startWith(2);
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  setCallback(client);
  client.duringCallback = [&] { sim.hold(WORLD); };
  putHealth(2, 1);
  sim.run();
  auto *function = module().function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy");
  auto destroying = sim.spawn("client", [&] { function(client.instance); });
  sim.run();
  EXPECT_FALSE(destroying.ended()) << "the callback has the instance's lock";
  client.duringCallback = nullptr;
  traced();
  sim.release(WORLD);
  sim.finish(destroying);
  sim.run();
  const auto releases = traced({18});
  ASSERT_EQ(releases.size(), 2u);
  EXPECT_THAT(host::symbolize(reinterpret_cast<void *>(releases[0].payload[2])),
              ::testing::StartsWith("KARSTResolver_Destroy"));
  EXPECT_EQ(releases[1].payload[1], 1u) << "the world's was the last reference";
  EXPECT_EQ(client.states.size(), 2u);
}

TEST_F(Resolver, CallsForADestroyedInstanceDoNothing) {
  putObject(1, 2);
  startWith(3);
  const size_t before = blocks();
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  sim.hold("karst-delivery");
  KARSTResolverInstance *instance = client.instance;
  setCallback(client);
  traced();
  destroy(client);
  EXPECT_EQ(instance->refCount, 1u) << "the object's last call is due";
  KarstEntryHeader header{};
  header.uuid = objectUUID(1);
  header.owner = nodeUUID(2);
  tellLate("KARSTResolverObjectSubCbk", instance, header, ZEL_OK);
  auto *track = internal<void(KARSTResolverInstance *, zel_UUID)>("KARSTResolverTrackNode");
  sim.call("directory", [&] { track(instance, nodeUUID(2)); }); /* had looked before the destroy */
  client.instance = instance;
  setCallback(client); /* nothing is installed, nobody is called */
  EXPECT_EQ(instance->node, nullptr);
  EXPECT_EQ(instance->callback, nullptr);
  EXPECT_EQ(client.states.size(), 1u);
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(blocks(), before);
  EXPECT_THAT(tracedIds(), ElementsAre(2, 18, 18)) << "destroyed, and released twice";
}

/* ---- The world ------------------------------------------------------------------------------- */

TEST_F(Resolver, WorldGivesTheLockUpWhenSomebodyIsDue) {
  startWith(3);
  sim.hold(WORLD);
  for (uint32_t n : {3, 1, 2}) {
    putHealth(n, 1);
    sim.run();
  }
  traced();
  sim.clearHistory();
  sim.forcePreemption(2);
  sim.release(WORLD);
  sim.run();
  std::vector<uint64_t> generated; /* nodes, by the last byte of their UUIDs */
  for (const auto &record : traced({14})) generated.push_back(record.payload[2] >> 56);
  EXPECT_THAT(generated, ElementsAre(3, 1, 2)) << "nothing is lost on the way";
  EXPECT_EQ(calls({Call::zel_SpinlockLock}).size(), 3u)
      << "one cycle, and one more for each time it gave way";
}

}  // namespace
