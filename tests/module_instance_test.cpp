/* Instances: creation and each way that it fails, tracking, hint, change of owner, the local
 * locator, read-out, callbacks, destruction. */
#include "tests/module_fixture.h"

using sim::Call;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

enum Trace : uint32_t {
  CREATE_INSTANCE = 1,
  DESTROY_INSTANCE = 2,
  TRACK_NODE = 3,
  OBJECT_UPDATED = 4,
  OBJECT_DISAPPEARED = 5,
  UPDATE_ADDRESSES = 6,
  INVOKE_CALLBACK = 7,
  ADD_NODE = 12,
  REMOVE_NODE = 13,
  SET_CALLBACK = 17,
  RELEASE_INSTANCE = 18,
};
constexpr uint32_t RESOLVED = KARST_RESOLVER_STATE_RESOLVED;
constexpr uint32_t UNRESOLVED = KARST_RESOLVER_STATE_UNRESOLVED;

uint64_t low(const zel_UUID &uuid) {
  return KARSTResolverUUIDLow(&uuid);
}
uint64_t high(const zel_UUID &uuid) {
  return KARSTResolverUUIDHigh(&uuid);
}

class Instance : public ModuleTest {
 protected:
  void SetUp() override {
    for (uint32_t n : {1, 2, 3}) putSimpleNode(n);
    putObject(1, 2);
    start();
    traced();
  }
  zel_HeapID heap() { return host::heapsAlive().at(0); }
  size_t blocks() { return host::heapState(heap()).blocks.size(); }
};

/* ---- Create ---------------------------------------------------------------------------------- */

TEST_F(Instance, ForANodeIsResolvedAtOnce) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  KARSTResolverInstance *instance = client.instance;
  EXPECT_STREQ(instance->tag, "karstri");
  EXPECT_STREQ(instance->name, "node:a0000000-0000-0000-0000-000000000002");
  EXPECT_EQ(instance->refCount, 1u);
  EXPECT_EQ(instance->boundNodeUUID, nodeUUID(2));
  EXPECT_EQ(instance->hintNodeUUID, noUUID);
  EXPECT_EQ(cachedNode(2)->refCount, 3u);
  EXPECT_THAT(addresses(client), ElementsAre("10.0.0.2"));
  auto records = traced();
  ASSERT_EQ(records.size(), 3u);
  EXPECT_EQ(records[0].id, CREATE_INSTANCE);
  EXPECT_EQ(records[0].site, 485u);
  EXPECT_THAT(records[0].payload, ElementsAre(reinterpret_cast<uint64_t>(instance), objectType, 0,
                                              0, low(nodeUUID(2)), high(nodeUUID(2))));
  EXPECT_EQ(records[1].id, TRACK_NODE);
  EXPECT_EQ(records[1].payload[4], low(nodeUUID(2)));
  EXPECT_EQ(records[2].id, UPDATE_ADDRESSES);
  EXPECT_THAT(records[2].payload, ElementsAre(reinterpret_cast<uint64_t>(instance), 0, 0,
                                              low(nodeUUID(2)), high(nodeUUID(2)), 1));
  destroy(client);
  EXPECT_EQ(cachedNode(2)->refCount, 2u);
  EXPECT_THAT(tracedIds(), ElementsAre(DESTROY_INSTANCE, RELEASE_INSTANCE));
}

TEST_F(Instance, ForAnObjectFollowsItsOwner) {
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  KARSTResolverInstance *instance = client.instance;
  EXPECT_STREQ(instance->name, "object:c0000000-0000-0000-0000-000000000001");
  EXPECT_EQ(instance->objectQuery.type, objectType);
  EXPECT_EQ(instance->objectQuery.flags, 0x09);
  EXPECT_EQ(instance->objectQuery.uuid, objectUUID(1));
  EXPECT_EQ(instance->refCount, 2u) << "the creator and the subscription";
  EXPECT_EQ(instance->subscribed, 1);
  EXPECT_THAT(tracedIds({CREATE_INSTANCE, OBJECT_UPDATED, TRACK_NODE}),
              ElementsAre(CREATE_INSTANCE, OBJECT_UPDATED, TRACK_NODE));
  sim.run();
  EXPECT_THAT(tracedIds(), ElementsAre(OBJECT_UPDATED)) << "the owner is tracked already";
  destroy(client);
}

TEST_F(Instance, EntryTypeIsKeptWholeAndAskedForByItsLowByte) {
  putRaw(0x34, objectUUID(9), nodeUUID(3), {0xa0});
  Client client;
  ASSERT_EQ(create(client, objectUUID(9), noUUID, false, 0x1234), ZEL_OK);
  EXPECT_EQ(client.instance->entryType, 0x1234u);
  EXPECT_EQ(client.instance->objectQuery.type, 0x34);
  destroy(client);
}

/* Whatever cannot be resolved leaves nothing: no memory, no reference, no node. */
TEST_F(Instance, CreateFailsWithoutATrace) {
  putNode(5);      /* no interface */
  putObject(2, 9); /* an owner that nobody knows */
  putObject(3, 0); /* no owner */
  sim.run();
  struct Row {
    const char *what;
    zel_UUID object, node;
    bool local;
    zel_Status status;
  };
  const Row rows[] = {
      {"no UUID", noUUID, noUUID, false, ZEL_BAD_PARAM},
      {"node without locators", noUUID, nodeUUID(5), false, ZEL_NOT_FOUND},
      {"unknown node", noUUID, nodeUUID(77), false, ZEL_NOT_FOUND},
      {"unknown node, local", noUUID, nodeUUID(77), true, ZEL_NOT_FOUND},
      {"unknown object", objectUUID(77), noUUID, false, ZEL_NOT_FOUND},
      {"unknown object, unknown hint", objectUUID(77), nodeUUID(77), false, ZEL_NOT_FOUND},
      {"object of an unknown node", objectUUID(2), nodeUUID(2), false, ZEL_NOT_FOUND},
      {"object without an owner", objectUUID(3), noUUID, false, ZEL_NOT_FOUND},
  };
  size_t before = blocks(), nodes = cachedNodes();
  uint64_t references = cache()->refCount;
  for (const Row &row : rows) {
    SCOPED_TRACE(row.what);
    Client client;
    EXPECT_EQ(create(client, row.object, row.node, row.local), row.status);
    EXPECT_EQ(client.instance, nullptr);
    sim.run();
    EXPECT_EQ(blocks(), before);
    EXPECT_EQ(cachedNodes(), nodes);
    EXPECT_EQ(cache()->refCount, references);
  }
  EXPECT_EQ(sim.call("client",
                     [&] {
                       return module().function<decltype(KARSTResolver_Create)>(
                           "KARSTResolver_Create")(nullptr, 0, noUUID, nodeUUID(2), false);
                     }),
            ZEL_BAD_PARAM);
  EXPECT_THAT(log, IsEmpty());
}

TEST_F(Instance, NodeMadeForAFailedCreateGoesBackToTheFrontOfTheFreeList) {
  Client client;
  EXPECT_EQ(createForNode(client, 77), ZEL_NOT_FOUND);
  EXPECT_THAT(tracedIds({ADD_NODE, DESTROY_INSTANCE, REMOVE_NODE, RELEASE_INSTANCE}),
              ElementsAre(ADD_NODE, DESTROY_INSTANCE, REMOVE_NODE, RELEASE_INSTANCE));
}

TEST_F(Instance, CreateFailsWithTheStatusOfWhatFailed) {
  Client client;
  size_t before = blocks();
  sim.failAt(Call::zel_HeapAllocWithRA, 1);
  EXPECT_EQ(createForNode(client, 2), ZEL_NO_MEMORY);
  sim.failAt(Call::zel_SpinlockCreate, 1, 1, 0x0bad0777);
  EXPECT_EQ(createForNode(client, 2), 0x0bad0777u);
  EXPECT_THAT(log,
              ElementsAre("2 KARSTResolver: KARSTResolver_Create:N: Failed to create spinlock: "
                          "unknown status"));
  log.clear();
  EXPECT_THAT(tracedIds(), IsEmpty()) << "an instance without a lock never was";

  sim.failAt(Call::KARST_Subscribe, 1, 1, 0x0bad0778);
  EXPECT_EQ(createForObject(client, 1), 0x0bad0778u);
  EXPECT_THAT(log, ElementsAre("1 KARSTResolver: KARSTResolver_Create:N: Failed to install object "
                               "subscription: unknown status"));
  auto releases = traced({RELEASE_INSTANCE});
  ASSERT_EQ(releases.size(), 2u) << "the subscription's, then the creator's";
  EXPECT_EQ(releases[0].payload[1], 2u);
  EXPECT_EQ(releases[1].payload[1], 1u);
  EXPECT_EQ(blocks(), before);
}

TEST_F(Instance, CreateNeedsAUsableDirectory) {
  directory().setUsable(false);
  sim.run();
  Client client;
  EXPECT_EQ(createForNode(client, 2), ZEL_NOT_FOUND);
  EXPECT_EQ(createForNode(client, 1, true), ZEL_NOT_FOUND);
}

/* While init_module still runs, another module's thread may come early. */
TEST(InstanceEarly, CreateBeforeTheCacheExistsIsRefused) {
  struct Early : ModuleTest {
    void TestBody() override {
      ASSERT_EQ(load(), "");
      auto **cachePointer =
          static_cast<KARSTResolverCache **>(module().anySymbol("karstResolverCache"));
      KARSTResolverCache *kept = *cachePointer;
      *cachePointer = nullptr;
      Client client;
      EXPECT_EQ(createForNode(client, 1), ZEL_NOT_INITIALIZED);
      *cachePointer = kept;
    }
  };
  Early().TestBody();
}

/* ---- Local locator --------------------------------------------------------------------------- */

TEST_F(Instance, LocalLocatorStandsForThisHostWhateverItsState) {
  directory().remove(KARST_TYPE_NODE, nodeUUID(1));
  sim.run();
  Client local, plain, remote;
  ASSERT_EQ(createForNode(local, 1, true), ZEL_OK);
  EXPECT_EQ(createForNode(plain, 1, false), ZEL_NOT_FOUND);
  ASSERT_EQ(createForNode(remote, 2, true), ZEL_OK);
  KARSTResolverNodeLocators set{};
  set.capacity = 4;
  ASSERT_EQ(read(local, &set), ZEL_OK);
  EXPECT_EQ(set.count, 1);
  EXPECT_EQ(set.nodeUUID, nodeUUID(1));
  EXPECT_EQ(set.majorVersion, 7u) << "what its entry said last";
  EXPECT_EQ(set.trafficType, 0u);
  EXPECT_EQ(set.locators[0].networkType, KARST_RESOLVER_LOCATOR_LOCAL);
  EXPECT_THAT(set.locators[0].address, ::testing::Each(0));
  EXPECT_THAT(addresses(remote), ElementsAre("10.0.0.2"));
  destroy(local);
  destroy(remote);
}

/* ---- Read-out -------------------------------------------------------------------------------- */

TEST_F(Instance, ReadOutWritesWhatItSaysAndNothingElse) {
  putNode(2, 8, 4);
  putNetIf(2, 2, {"10.0.0.2", "fd00::2", "10.0.0.22"});
  sim.run();
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  for (uint16_t capacity : {0, 1, 2, 3, 4, 9}) {
    SCOPED_TRACE(capacity);
    std::vector<uint8_t> bytes(KARSTResolverNodeLocatorsSize(9) + 8, 0xee), before = bytes;
    auto *set = reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data());
    set->capacity = capacity;
    before = bytes;
    ASSERT_EQ(read(client, set), ZEL_OK);
    uint16_t count = std::min<uint16_t>(capacity, 3);
    EXPECT_EQ(set->nodeUUID, nodeUUID(2));
    EXPECT_EQ(set->majorVersion, 8u);
    EXPECT_EQ(set->minorVersion, 4u);
    EXPECT_EQ(set->trafficType, 0u);
    EXPECT_EQ(set->capacity, capacity);
    EXPECT_EQ(set->count, count);
    std::vector<std::string> expected = {"10.0.0.2", "fd00::2", "10.0.0.22"};
    expected.resize(count);
    EXPECT_EQ(textsOf(*set), expected);
    auto same = [&](size_t from, size_t to) {
      return std::equal(bytes.begin() + static_cast<long>(from),
                        bytes.begin() + static_cast<long>(to),
                        before.begin() + static_cast<long>(from));
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

TEST_F(Instance, ReadOutTakesTheInstancesLockOnly) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  sim.clearHistory();
  addresses(client);
  EXPECT_THAT(calls({Call::zel_SpinlockLock, Call::zel_SpinlockUnlock}),
              ElementsAre("zel_SpinlockLock", "zel_SpinlockUnlock"));
  destroy(client);
}

/* ---- Callbacks ------------------------------------------------------------------------------- */

TEST_F(Instance, CallbackIsCalledAtOnceAndAtEveryRefresh) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  traced();
  setCallback(client);
  EXPECT_THAT(client.states, ElementsAre(RESOLVED));
  EXPECT_THAT(tracedIds(), ElementsAre(SET_CALLBACK, INVOKE_CALLBACK));
  putHealth(2, 1);
  sim.run();
  putHealth(2, 0);
  sim.run();
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  sim.run();
  putNode(2);
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED, RESOLVED, UNRESOLVED, RESOLVED));
  EXPECT_THAT(client.counts, ElementsAre(1, 0, 1, 0, 1));
  putNetIf(2, 2, {"10.0.0.2"}, 0x5); /* another record, the same answer */
  sim.run();
  EXPECT_EQ(client.states.size(), 6u) << "a refresh that changes nothing still calls";
  removeCallback(client);
  putHealth(2, 1);
  sim.run();
  EXPECT_EQ(client.states.size(), 6u);
  destroy(client);
}

TEST_F(Instance, CallbackRunsUnderTheInstancesLockAlone) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  auto heldBy = [&](KARSTResolverLock lock) {
    return reinterpret_cast<sim::Spinlock *>(lock.handle)->holder != nullptr;
  };
  std::vector<bool> cacheHeld, instanceHeld;
  client.duringCallback = [&]() KARST_UNCHECKED {
    cacheHeld.push_back(heldBy(cache()->lock));
    instanceHeld.push_back(heldBy(client.instance->lock));
  };
  setCallback(client);
  putHealth(2, 1);
  sim.run();
  EXPECT_THAT(cacheHeld, ElementsAre(false, false));
  EXPECT_THAT(instanceHeld, ElementsAre(true, true));
  destroy(client);
}

/* ---- Objects --------------------------------------------------------------------------------- */

TEST_F(Instance, ObjectThatMovesIsLostForGood) {
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  setCallback(client);
  traced();
  putObject(1, 3);
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED));
  EXPECT_EQ(client.instance->nodeChanged, 1);
  EXPECT_EQ(client.instance->node, nullptr);
  auto updated = traced({OBJECT_UPDATED});
  ASSERT_GE(updated.size(), 1u);
  EXPECT_EQ(updated[0].payload[4], low(nodeUUID(2))) << "the node tracked before";
  putObject(1, 2);
  sim.run();
  EXPECT_EQ(client.states.size(), 2u);
  EXPECT_THAT(addresses(client), IsEmpty());
  Client again;
  ASSERT_EQ(createForObject(again, 1), ZEL_OK);
  EXPECT_THAT(addresses(again), ElementsAre("10.0.0.2"));
  destroy(client);
  destroy(again);
}

TEST_F(Instance, ObjectThatComesBackToItsOwnerIsResolvedAgain) {
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  setCallback(client);
  traced();
  directory().remove(objectType, objectUUID(1));
  sim.run();
  EXPECT_THAT(tracedIds({OBJECT_UPDATED, OBJECT_DISAPPEARED, TRACK_NODE}),
              ElementsAre(OBJECT_DISAPPEARED, TRACK_NODE));
  EXPECT_EQ(client.instance->nodeChanged, 0);
  const KARSTResolverNodeLocators nothing{};
  EXPECT_EQ(std::memcmp(&client.instance->locators, &nothing, sizeof nothing), 0);
  putObject(1, 2);
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED, RESOLVED));
  destroy(client);
}

TEST_F(Instance, HintServesUntilTheObjectIsFound) {
  Client client;
  ASSERT_EQ(createForObject(client, 8, 3), ZEL_OK);
  EXPECT_THAT(addresses(client), ElementsAre("10.0.0.3"));
  EXPECT_EQ(client.instance->useHintNode, 1);
  EXPECT_THAT(tracedIds({OBJECT_UPDATED, OBJECT_DISAPPEARED}), IsEmpty());
  setCallback(client);
  putObject(8, 3);
  sim.run();
  EXPECT_EQ(client.instance->useHintNode, 0);
  EXPECT_THAT(client.states, ElementsAre(RESOLVED)) << "the owner is the hint: stays attached";
  directory().remove(objectType, objectUUID(8));
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED)) << "the hint has served";
  destroy(client);

  Client wrong;
  ASSERT_EQ(createForObject(wrong, 9, 3), ZEL_OK);
  putObject(9, 2);
  sim.run();
  EXPECT_EQ(wrong.instance->nodeChanged, 1) << "bound to the hint, owned by another";
  EXPECT_THAT(addresses(wrong), IsEmpty());
  destroy(wrong);
}

TEST_F(Instance, LostObjectEventsAreLookedUp) {
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  setCallback(client);
  sim.hold("karst-delivery");
  directory().remove(objectType, objectUUID(1));
  directory().resync();
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(client.states.back(), UNRESOLVED);
  destroy(client);
}

/* ---- Destroy --------------------------------------------------------------------------------- */

TEST_F(Instance, ObjectInstanceIsFreedByWhoeverComesLast) {
  size_t before = blocks();
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  sim.hold("karst-delivery");
  traced();
  KARSTResolverInstance *instance = client.instance;
  setCallback(client);
  destroy(client);
  EXPECT_GT(blocks(), before);
  EXPECT_EQ(instance->destroyed, 1);
  EXPECT_EQ(instance->refCount, 1u);
  EXPECT_EQ(instance->node, nullptr);
  EXPECT_EQ(instance->callback, nullptr);
  client.instance = instance;
  setCallback(client); /* too late: nothing is installed, nobody is called */
  EXPECT_EQ(instance->callback, nullptr);
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(blocks(), before);
  EXPECT_EQ(client.states.size(), 1u);
  auto releases = traced({RELEASE_INSTANCE});
  ASSERT_EQ(releases.size(), 2u);
  EXPECT_EQ(releases[0].payload[1], 2u);
  EXPECT_EQ(releases[1].payload[1], 1u);
  EXPECT_THAT(host::symbolize(reinterpret_cast<void *>(releases[0].payload[2])),
              ::testing::StartsWith("KARSTResolver_Destroy"));
  EXPECT_THAT(host::symbolize(reinterpret_cast<void *>(releases[1].payload[2])),
              ::testing::StartsWith("KARSTResolverObjectSubCbk"));
}

TEST_F(Instance, LastInstanceTakesItsNodeAlong) {
  Client client;
  ASSERT_EQ(createForNode(client, 3), ZEL_OK);
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(3));
  directory().remove(KARST_TYPE_NODE, nodeUUID(3));
  sim.run();
  ASSERT_NE(cachedNode(3), nullptr);
  traced();
  destroy(client);
  EXPECT_EQ(cachedNode(3), nullptr);
  EXPECT_THAT(tracedIds(), ElementsAre(DESTROY_INSTANCE, REMOVE_NODE, RELEASE_INSTANCE));
}

}  // namespace
