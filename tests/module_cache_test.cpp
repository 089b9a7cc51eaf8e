/* The cache: enable and disable, nodes and interfaces from their entries, faults in records,
 * rescans, capacity, and the locators that come of it. */
#include <random>

#include "tests/module_fixture.h"

using sim::Call;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;

namespace {

enum Trace : uint32_t {
  ADD_NETIF = 8,
  REMOVE_NETIF = 9,
  UPDATE_NETIF_INFO = 10,
  UPDATE_NETIF_HEALTH = 11,
  ADD_NODE = 12,
  REMOVE_NODE = 13,
  REACHABILITY = 14,
  RESCAN_NETIFS = 15,
  RESCAN_NODES = 16,
};

class Cache : public ModuleTest {
 protected:
  using ModuleTest::ModuleTest;

  KARSTResolverNetIf *netIf(uint32_t number) {
    for (auto *found : cachedNetIfs()) {
      if (found->uuid == netIfUUID(number)) return found;
    }
    return nullptr;
  }
  std::vector<std::string> nodeLocators(uint32_t node) {
    return textsOf(cachedNode(node)->locators);
  }
  size_t freeNodes() { return length(&cache()->freeNodes); }
  size_t freeNetIfs() { return length(&cache()->freeNetIfs); }
  static size_t length(const KARSTResolverLink *head) {
    size_t count = 0;
    for (auto *link = head->next; link != head; link = link->next) count++;
    return count;
  }
};

/* ---- Enable and disable ---------------------------------------------------------------------- */

TEST_F(Cache, EnablesWhenTheDirectoryIsUsable) {
  ASSERT_EQ(load(), "");
  sim.run();
  EXPECT_EQ(cache()->enabled, 0);
  EXPECT_STREQ(cache()->tag, "karstrc");
  directory().setSelf(nodeUUID(1));
  sim.clearHistory();
  directory().setUsable(true);
  sim.run();
  EXPECT_THAT(
      calls({Call::KARST_GetSelfUUID, Call::TOLM_WorldCreate, Call::KARST_Subscribe}),
      ElementsAre("KARST_GetSelfUUID", "TOLM_WorldCreate", "KARST_Subscribe", "KARST_Subscribe"));
  EXPECT_EQ(cache()->enabled, 1);
  EXPECT_EQ(cache()->refCount, 2u);
  EXPECT_EQ(cache()->selfUUID, nodeUUID(1));
  EXPECT_EQ(cache()->nodeSub.type, 3);
  EXPECT_EQ(cache()->nodeSub.flags, 0x0b);
  EXPECT_EQ(cache()->netIfSub.type, 6);
  EXPECT_EQ(cache()->netIfSub.flags, 0x0b);
}

TEST_F(Cache, DisableForgetsEverythingAndEnableLearnsItAgain) {
  putSimpleNode(1);
  putSimpleNode(2);
  start();
  EXPECT_EQ(cachedNodes(), 2u);
  EXPECT_EQ(cache()->refCount, 4u) << "two subscriptions and two healths";
  for (int cycle = 0; cycle < 3; cycle++) {
    sim.clearHistory();
    directory().setUsable(false);
    sim.run();
    EXPECT_THAT(calls({Call::TOLM_WorldDestroy, Call::KARST_Unsubscribe}),
                ElementsAre("TOLM_WorldDestroy", "KARST_Unsubscribe", "KARST_Unsubscribe",
                            "KARST_Unsubscribe", "KARST_Unsubscribe"));
    EXPECT_EQ(cachedNodes(), 0u);
    EXPECT_EQ(freeNodes(), KARST_RESOLVER_NODE_POOL_SIZE);
    EXPECT_EQ(freeNetIfs(), KARST_RESOLVER_NETIF_POOL_SIZE);
    EXPECT_EQ(cache()->refCount, 0u);
    directory().setUsable(true);
    sim.run();
    EXPECT_THAT(nodeLocators(2), ElementsAre("10.0.0.2"));
  }
}

TEST_F(Cache, NodesThatInstancesHoldOutliveADisable) {
  putSimpleNode(1);
  start();
  Client client;
  ASSERT_EQ(createForNode(client, 1), ZEL_OK);
  setCallback(client);
  directory().setUsable(false);
  sim.run();
  ASSERT_EQ(cachedNodes(), 1u);
  EXPECT_EQ(cachedNode(1)->reachable, 0);
  EXPECT_EQ(cachedNode(1)->dirtyLinks.next, nullptr) << "a disabled cache queues nothing";
  directory().setUsable(true);
  sim.run();
  EXPECT_THAT(addresses(client), ElementsAre("10.0.0.1"));
  destroy(client);
}

TEST_F(Cache, InstancesLearnWhatADisableMissed) {
  for (uint32_t n : {1, 2}) putSimpleNode(n);
  putObject(1, 1);
  start();
  Client node, object;
  ASSERT_EQ(createForNode(node, 2), ZEL_OK);
  ASSERT_EQ(createForObject(object, 1), ZEL_OK);
  for (Client *client : {&node, &object}) setCallback(*client);
  directory().setUsable(false);
  sim.run();
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(2));
  directory().remove(objectType, objectUUID(1));
  sim.run();
  putObject(1, 1);
  sim.run();
  EXPECT_THAT(addresses(node), ElementsAre("10.0.0.2")) << "nobody refreshes it";
  EXPECT_THAT(addresses(object), IsEmpty()) << "it found no node to attach to";
  directory().setUsable(true);
  sim.run();
  EXPECT_THAT(addresses(node), IsEmpty());
  EXPECT_THAT(addresses(object), ElementsAre("10.0.0.1"));
  EXPECT_EQ(node.states.back(), KARST_RESOLVER_STATE_UNRESOLVED);
  EXPECT_EQ(object.states.back(), KARST_RESOLVER_STATE_RESOLVED);
  for (Client *client : {&node, &object}) destroy(*client);
}

TEST_F(Cache, DirtyNodesWaitForTheNextWorld) {
  putSimpleNode(1);
  start();
  Client client;
  ASSERT_EQ(createForNode(client, 1), ZEL_OK);
  sim.hold("KARSTResolverCache");
  putHealth(1, 5);
  sim.run();
  ASSERT_NE(cachedNode(1)->dirtyLinks.next, nullptr);
  directory().setUsable(false); /* asks the world to stop before it has looked */
  sim.release("KARSTResolverCache");
  sim.run();
  directory().setUsable(true);
  sim.run();
  EXPECT_EQ(cachedNode(1)->dirtyLinks.next, nullptr);
  EXPECT_THAT(addresses(client), IsEmpty());
  destroy(client);
}

TEST_F(Cache, FailedEnableLeavesItDisabledUntilTheNext) {
  struct Row {
    Call call;
    uint64_t nth;
    const char *report;
  };
  const Row rows[] = {
      {Call::TOLM_WorldCreate, 1, "Failed to create world: ZEL_NO_MEMORY"},
      {Call::KARST_Subscribe, 1, "Failed to install node subscription: ZEL_NO_MEMORY"},
      {Call::KARST_Subscribe, 2, "Failed to install netif subscription: ZEL_NO_MEMORY"},
  };
  putSimpleNode(1);
  ASSERT_EQ(load(), "");
  for (const Row &row : rows) {
    SCOPED_TRACE(row.report);
    sim.failAt(row.call, row.nth);
    directory().setUsable(true);
    sim.run();
    EXPECT_THAT(log, ElementsAre("2 KARSTResolver: KARSTResolverCacheEnable:N: " +
                                 std::string(row.report)));
    EXPECT_EQ(cache()->enabled, 0);
    EXPECT_EQ(cache()->refCount, 0u);
    log.clear();
    directory().setUsable(false);
    sim.run();
  }
  directory().setUsable(true);
  sim.run();
  EXPECT_EQ(cachedNodes(), 1u);
}

TEST_F(Cache, UnloadWaitsForLastCallsAndInstances) {
  putSimpleNode(1);
  putObject(1, 1);
  start();
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

/* Entries that come and go around interruptions of any length, in an order that the seed decides,
 * with now one delivery thread held back, now the other: when all is quiet, every answer is the
 * directory's. */
class Interruptions : public Cache, public ::testing::WithParamInterface<uint64_t> {
 protected:
  Interruptions() : Cache(settings()) {}
  static sim::Settings settings() {
    sim::Settings settings = defaults();
    settings.seed = GetParam();
    settings.queueBound = 4;
    return settings;
  }
  void putOrRemove(const host::Entry &entry) {
    directory().entry(entry.type, entry.uuid) ? directory().remove(entry.type, entry.uuid)
                                              : directory().put(entry);
  }
};

TEST_P(Interruptions, LeaveNoStaleAnswer) {
  constexpr uint32_t count = 3;
  std::vector<host::Entry> nodes, netIfs, objects;
  for (uint32_t n = 1; n <= count; n++) {
    putSimpleNode(n);
    putObject(n, n);
    nodes.push_back(*directory().entry(KARST_TYPE_NODE, nodeUUID(n)));
    netIfs.push_back(*directory().entry(KARST_TYPE_NET_INTERFACE, netIfUUID(n)));
    objects.push_back(*directory().entry(objectType, objectUUID(n)));
  }
  start();
  std::vector<Client> ofNodes(count), ofObjects(count);
  for (uint32_t n = 1; n <= count; n++) {
    ASSERT_EQ(createForNode(ofNodes[n - 1], n), ZEL_OK);
    ASSERT_EQ(createForObject(ofObjects[n - 1], n), ZEL_OK);
  }
  sim.run();
  sim.setSwitching(sim::Switching::Random);
  sim.finish(sim.spawn("source", [&] {
    std::minstd_rand random(static_cast<uint32_t>(GetParam()));
    for (int i = 0; i < 60; i++) {
      const uint32_t what = random() % 4, n = random() % count;
      if (what == 0) directory().setUsable(random() % 2 == 0);
      if (what == 1) {
        putOrRemove(nodes[n]);
        putOrRemove(netIfs[n]);
      }
      if (what == 2) putOrRemove(objects[n]);
      if (what == 3) {
        sim.releaseAll();
        if (random() % 2 == 0) {
          sim.hold("karst-delivery-" + std::to_string(random() % 2));
        } else {
          directory().waitUntilIdle();
        }
      }
    }
    directory().setUsable(true);
  }));
  sim.run(); /* the one that is held back comes late */
  sim.releaseAll();
  sim.run();
  for (uint32_t n = 1; n <= count; n++) {
    const bool nodeIsThere = directory().entry(KARST_TYPE_NODE, nodeUUID(n)).has_value();
    const bool objectIsThere = directory().entry(objectType, objectUUID(n)).has_value();
    std::vector<std::string> expected = {"10.0.0." + std::to_string(n)};
    if (!nodeIsThere) expected.clear();
    EXPECT_EQ(addresses(ofNodes[n - 1]), expected) << "node " << n;
    if (!objectIsThere) expected.clear();
    EXPECT_EQ(addresses(ofObjects[n - 1]), expected) << "object " << n;
    destroy(ofNodes[n - 1]);
    destroy(ofObjects[n - 1]);
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, Interruptions, ::testing::Range<uint64_t>(1, 60));

/* ---- Nodes ----------------------------------------------------------------------------------- */

TEST_F(Cache, NodeEntryMakesTheNodeReachable) {
  start();
  traced();
  putNode(2, 8, 3);
  sim.run();
  KARSTResolverNode *node = cachedNode(2);
  ASSERT_NE(node, nullptr);
  EXPECT_STREQ(node->tag, "karstrn");
  EXPECT_EQ(node->refCount, 1u);
  EXPECT_EQ(node->reachable, 1);
  EXPECT_EQ(node->isSelf, 0);
  EXPECT_EQ(node->majorVersion, 8u);
  EXPECT_EQ(node->locators.minorVersion, 3u);
  EXPECT_EQ(node->locators.capacity, 4);
  auto records = traced();
  ASSERT_EQ(records.size(), 3u);
  EXPECT_EQ(records[0].id, ADD_NODE);
  EXPECT_EQ(records[0].payload[0], reinterpret_cast<uint64_t>(node));
  EXPECT_EQ(records[0].payload[3], 0u);
  EXPECT_EQ(records[1].id, REACHABILITY);
  EXPECT_EQ(records[1].site, 50u);
  EXPECT_EQ(records[1].payload[3], 1u);
  EXPECT_EQ(records[2].site, 578u) << "the generation";

  putNode(2, 9, 0, KARST_NODE_FLAG_WITNESS | 1);
  putNode(1);
  sim.run();
  EXPECT_EQ(node->majorVersion, 9u);
  EXPECT_EQ(node->isWitness, 1);
  EXPECT_EQ(cachedNode(1)->isSelf, 1);
  putNode(2, 9, 0, 1);
  sim.run();
  EXPECT_EQ(node->isWitness, 0);
}

TEST_F(Cache, NodeLeavesWithItsLastReference) {
  putSimpleNode(2);
  start();
  KARSTResolverNode *node = cachedNode(2);
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  sim.run();
  ASSERT_EQ(cachedNode(2), node) << "its interface holds it";
  EXPECT_EQ(node->reachable, 0);
  EXPECT_EQ(node->refCount, 1u);
  traced();
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(2));
  sim.run();
  EXPECT_EQ(cachedNode(2), nullptr);
  EXPECT_THAT(tracedIds(), ElementsAre(REMOVE_NETIF, REMOVE_NODE));
  EXPECT_EQ(node->tag[0], static_cast<char>(~'k'));
  EXPECT_EQ(cache()->freeNodes.next, &node->freeLinks) << "reused first";
  EXPECT_EQ(cache()->dirtyNodes.next, &cache()->dirtyNodes) << "not queued any more";
}

TEST_F(Cache, NodeWhoseEntryCannotBeReadIsUnreachable) {
  start();
  const std::string function = "2 KARSTResolver: KARSTResolverUpdateNodeVersionLocked:N: ";
  const std::string uuid = "a0000000-0000-0000-0000-000000000002";
  putRaw(KARST_TYPE_NODE, nodeUUID(2), nodeUUID(2));
  sim.run();
  EXPECT_EQ(cachedNode(2), nullptr) << "nothing else holds it";
  EXPECT_THAT(tracedIds(), ElementsAre(ADD_NODE, REACHABILITY, REACHABILITY, REMOVE_NODE));
  EXPECT_THAT(log, ElementsAre(function + "Failed to unmarshal node entry " + uuid +
                               ": EXPR_MSH_MALFORMED"));
  log.clear();
  sim.failAt(Call::KARST_FindFullEntryByQuery, 1);
  putNode(2);
  sim.run();
  EXPECT_EQ(cachedNode(2), nullptr);
  EXPECT_THAT(log, ElementsAre(function + "Failed to find node entry " + uuid + ": ZEL_NO_MEMORY"));
}

TEST_F(Cache, NodeRescanReconciles) {
  for (uint32_t n : {2, 3, 4}) putNode(n);
  start();
  traced();
  sim.hold("karst-delivery");
  directory().remove(KARST_TYPE_NODE, nodeUUID(2));
  putNode(3, 30);
  putRaw(KARST_TYPE_NODE, nodeUUID(4), nodeUUID(4));
  putNode(5);
  directory().resync(); /* in place of all that */
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(tracedIds({RESCAN_NODES}).size(), 1u);
  EXPECT_EQ(cachedNode(2), nullptr);
  EXPECT_EQ(cachedNode(3)->majorVersion, 30u);
  EXPECT_EQ(cachedNode(4), nullptr);
  EXPECT_EQ(cachedNode(5)->reachable, 1);
  for (uint32_t n : {3, 5}) EXPECT_EQ(cachedNode(n)->rescanSeen, 0);
}

TEST_F(Cache, NodeSlotsAreBounded) {
  for (uint32_t n = 1; n <= KARST_RESOLVER_NODE_POOL_SIZE + 5; n++) putNode(n);
  start();
  EXPECT_EQ(cachedNodes(), KARST_RESOLVER_NODE_POOL_SIZE);
  EXPECT_EQ(freeNodes(), 0u);
  EXPECT_EQ(cachedNode(KARST_RESOLVER_NODE_POOL_SIZE + 1), nullptr);
  putNetIf(1, KARST_RESOLVER_NODE_POOL_SIZE + 1, {"10.0.0.1"});
  sim.run();
  EXPECT_THAT(cachedNetIfs(), IsEmpty()) << "no place for its owner";
  EXPECT_THAT(log, IsEmpty());
  directory().remove(KARST_TYPE_NODE, nodeUUID(7));
  putNode(KARST_RESOLVER_NODE_POOL_SIZE + 1, 99);
  sim.run();
  EXPECT_EQ(cachedNode(KARST_RESOLVER_NODE_POOL_SIZE + 1)->majorVersion, 99u);
}

/* ---- Interfaces ------------------------------------------------------------------------------ */

TEST_F(Cache, InterfaceFollowsItsEntryAndItsHealth) {
  putNode(2);
  start();
  traced();
  putNetIf(5, 2, {"10.0.0.5"});
  sim.run();
  ASSERT_NE(netIf(5), nullptr);
  EXPECT_EQ(std::string(netIf(5)->tag, 8), "karstrni");
  EXPECT_STREQ(netIf(5)->uuidString, "b0000000-0000-0000-0000-000000000005");
  EXPECT_EQ(netIf(5)->healthy, 0);
  EXPECT_EQ(netIf(5)->health.healthFlags, 0xffffffffu) << "no health entry";
  EXPECT_EQ(netIf(5)->info.trafficTypeMask, ~0ull) << "names none: carries all";
  EXPECT_EQ(netIf(5)->healthSubInstalled, 1);
  EXPECT_EQ(netIf(5)->healthSub.type, 7);
  EXPECT_EQ(netIf(5)->healthSub.flags, 0x09);
  EXPECT_EQ(netIf(5)->refCount, 2u);
  EXPECT_EQ(cachedNode(2)->refCount, 2u);
  EXPECT_THAT(tracedIds(),
              ElementsAre(ADD_NETIF, UPDATE_NETIF_HEALTH, UPDATE_NETIF_INFO, REACHABILITY));

  putHealth(5, 0);
  sim.run();
  EXPECT_THAT(tracedIds(), ElementsAre(UPDATE_NETIF_HEALTH, REACHABILITY));
  EXPECT_THAT(nodeLocators(2), ElementsAre("10.0.0.5"));
  putHealth(5, 0, 77); /* only the time stamp */
  sim.run();
  EXPECT_EQ(netIf(5)->health.timestamp, 77u);
  EXPECT_THAT(tracedIds(), IsEmpty());
  putHealth(5, 4);
  sim.run();
  EXPECT_THAT(nodeLocators(2), IsEmpty());
  directory().remove(KARST_TYPE_HEALTH_STATUS, netIfUUID(5));
  sim.run();
  EXPECT_EQ(netIf(5)->health.timestamp, ~0ull);
}

TEST_F(Cache, UnchangedRecordWakesNobodyAndAnyByteIsAChange) {
  putSimpleNode(2);
  start();
  traced();
  KarstNetInterfaceEntry record = netIfRecord({"10.0.0.2"});
  record.trafficTypeMask = ~0ull; /* says what the absent mask meant */
  uint64_t wakeUps = sim.uses(Call::zel_WorldForceWakeup);
  putNetIf(2, 2, record);
  sim.run();
  EXPECT_THAT(tracedIds(), IsEmpty());
  EXPECT_EQ(sim.uses(Call::zel_WorldForceWakeup), wakeUps);
  record.bandwidth = 1;
  putNetIf(2, 2, record);
  sim.run();
  EXPECT_THAT(tracedIds(), ElementsAre(UPDATE_NETIF_INFO, REACHABILITY));
}

TEST_F(Cache, InterfaceMovesToItsNewOwner) {
  putSimpleNode(2);
  putNode(3);
  start();
  putNetIf(2, 3, {"10.0.0.2"});
  sim.run();
  EXPECT_THAT(nodeLocators(2), IsEmpty());
  EXPECT_THAT(nodeLocators(3), ElementsAre("10.0.0.2"));
  EXPECT_THAT(log, IsEmpty());
  EXPECT_EQ(cachedNetIfs().size(), 1u);
}

/* The entry has moved on before its first event is looked at. */
TEST_F(Cache, OwnerThatChangedMeanwhileIsReported) {
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

TEST_F(Cache, InterfaceThatCannotBeReadIsDestroyed) {
  putSimpleNode(2);
  start();
  putRaw(KARST_TYPE_NET_INTERFACE, netIfUUID(2), nodeUUID(2));
  sim.run();
  EXPECT_THAT(log,
              ElementsAre("2 KARSTResolver: KARSTResolverUpdateNetIf:N: Failed to unmarshal netif "
                          "entry b0000000-0000-0000-0000-000000000002: EXPR_MSH_MALFORMED"));
  EXPECT_THAT(cachedNetIfs(), IsEmpty());
  log.clear();
  sim.failAt(Call::KARST_FindFullEntryByQuery, 2); /* health is read first */
  putNetIf(2, 2, {"10.0.0.9"});
  sim.run();
  EXPECT_THAT(cachedNetIfs(), IsEmpty());
  EXPECT_THAT(log, IsEmpty()) << "an entry that is gone is nothing to report";
  EXPECT_EQ(freeNetIfs(), KARST_RESOLVER_NETIF_POOL_SIZE);
}

TEST_F(Cache, UndecodableHealthIsReportedAndUsedAsFarAsItWasRead) {
  putSimpleNode(2);
  start();
  /* {"healthFlags": 3, "timestamp": <text>} */
  std::vector<uint8_t> data = {0xa2, 0x6b, 'h', 'e', 'a', 'l', 't', 'h', 'F', 'l', 'a', 'g',  's',
                               0x03, 0x69, 't', 'i', 'm', 'e', 's', 't', 'a', 'm', 'p', 0x61, 'x'};
  putRaw(KARST_TYPE_HEALTH_STATUS, netIfUUID(2), noUUID, data);
  sim.run();
  EXPECT_THAT(log, ElementsAre("2 KARSTResolver: KARSTResolverUpdateNetIfHealth:N: Failed to "
                               "unmarshal health entry b0000000-0000-0000-0000-000000000002: "
                               "EXPR_MSH_BAD_TYPE"));
  EXPECT_EQ(netIf(2)->health.healthFlags, 3u);
  EXPECT_EQ(netIf(2)->healthy, 0);
}

TEST_F(Cache, DestroyedInterfaceKeepsItsSlotUntilTheLastCall) {
  putSimpleNode(2);
  start();
  KARSTResolverNetIf *gone = netIf(2);
  sim.hold("karst-delivery");
  putHealth(2, 9);
  auto *callback = internal<zel_Status(void *, const KarstEntryHeader *, void *, zel_Status)>(
      "KARSTResolverNetIfSubCbk");
  KarstEntryHeader header{};
  header.uuid = netIfUUID(2);
  header.owner = nodeUUID(2);
  sim.call("directory", [&] { callback(cache(), &header, nullptr, ZEL_NOT_FOUND); });
  EXPECT_THAT(cachedNetIfs(), IsEmpty());
  EXPECT_EQ(gone->refCount, 1u);
  EXPECT_EQ(gone->node, nullptr);
  EXPECT_EQ(freeNetIfs(), KARST_RESOLVER_NETIF_POOL_SIZE - 1);
  auto *health = internal<zel_Status(void *, const KarstEntryHeader *, void *, zel_Status)>(
      "KARSTResolverNetIfHealthSubCbk");
  sim.call("directory", [&] { health(gone, nullptr, nullptr, ZEL_OK); }); /* late: nothing */
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(freeNetIfs(), KARST_RESOLVER_NETIF_POOL_SIZE);
  EXPECT_EQ(gone->tag[0], static_cast<char>(~'k'));
  EXPECT_EQ(cache()->freeNetIfs.previous, &gone->freeLinks) << "reused last";
}

TEST_F(Cache, HealthSubscriptionIsTriedAgainInTheNextCycle) {
  putNode(2);
  start();
  sim.failAt(Call::KARST_Subscribe, 1);
  putHealth(4, 0);
  putNetIf(4, 2, {"10.0.0.4"});
  sim.run();
  EXPECT_EQ(netIf(4)->healthSubInstalled, 0);
  EXPECT_EQ(netIf(4)->refCount, 1u);
  EXPECT_EQ(cache()->refCount, 2u);
  putNode(3); /* wakes the world */
  sim.run();
  EXPECT_EQ(netIf(4)->healthSubInstalled, 1);
  EXPECT_EQ(cache()->refCount, 3u);
}

TEST_F(Cache, InterfaceRescanReconciles) {
  putSimpleNode(2);
  putSimpleNode(3);
  putSimpleNode(4);
  start();
  traced();
  sim.hold("karst-delivery");
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(2));
  putNetIf(3, 4, {"10.0.0.33"});
  putRaw(KARST_TYPE_NET_INTERFACE, netIfUUID(4), nodeUUID(4));
  putNetIf(5, 2, {"10.0.0.5"});
  directory().resync();
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(tracedIds({RESCAN_NETIFS}).size(), 1u);
  EXPECT_EQ(netIf(2), nullptr);
  EXPECT_EQ(netIf(3)->node, cachedNode(4));
  EXPECT_EQ(netIf(4), nullptr);
  EXPECT_EQ(netIf(5)->node, cachedNode(2));
  for (auto *found : cachedNetIfs()) EXPECT_EQ(found->rescanSeen, 0);
}

TEST_F(Cache, InterfaceSlotsAreBounded) {
  putNode(1);
  for (uint32_t n = 1; n <= KARST_RESOLVER_NETIF_POOL_SIZE + 3; n++) putNetIf(n, 1, {"10.0.0.1"});
  start();
  EXPECT_EQ(cachedNetIfs().size(), KARST_RESOLVER_NETIF_POOL_SIZE);
  EXPECT_EQ(freeNetIfs(), 0u);
  EXPECT_THAT(log, IsEmpty());
}

/* ---- Overflow -------------------------------------------------------------------------------- */

TEST_F(Cache, OverflowEndsInTheRightAnswer) {
  start();
  sim.hold("karst-delivery");
  for (uint32_t round = 0; round < 40; round++) {
    for (uint32_t n = 1; n <= 40; n++) putNode(n, round);
  }
  directory().remove(KARST_TYPE_NODE, nodeUUID(40));
  sim.release("karst-delivery");
  sim.run();
  EXPECT_GT(directory().overflows(), 0u);
  EXPECT_GE(tracedIds({RESCAN_NODES}).size(), 1u);
  EXPECT_EQ(cachedNodes(), 39u);
  for (uint32_t n = 1; n <= 39; n++) EXPECT_EQ(cachedNode(n)->majorVersion, 39u);
}

/* ---- Locators -------------------------------------------------------------------------------- */

class Locators : public Cache {
 protected:
  void SetUp() override {
    start();
    putNode(2);
  }
  void healthyNetIf(uint32_t number, std::initializer_list<const char *> texts,
                    uint64_t trafficTypeMask = 0) {
    putHealth(number, 0);
    putNetIf(number, 2, texts, trafficTypeMask);
  }
  std::vector<std::string> answer() {
    sim.run();
    return nodeLocators(2);
  }
};

TEST_F(Locators, InOrderOfCreationThenOfTheRecordFourAtMost) {
  healthyNetIf(9, {"fd00::9", "10.0.0.9"});
  sim.run(); /* created first, though its UUID is the larger one */
  healthyNetIf(3, {"10.0.0.3", "fd00::3", "10.0.0.33"});
  EXPECT_THAT(answer(), ElementsAre("fd00::9", "10.0.0.9", "10.0.0.3", "fd00::3"));
  KarstNetInterfaceEntry odd = netIfRecord({"10.0.0.1"});
  odd.networkType = 7;
  putHealth(10, 0);
  putNetIf(10, 2, odd);
  EXPECT_EQ(answer().size(), 4u);
  EXPECT_THAT(log, IsEmpty()) << "behind the fourth locator nobody looks";
  putHealth(9, 1);
  EXPECT_THAT(answer(), ElementsAre("10.0.0.3", "fd00::3", "10.0.0.33"));
  EXPECT_THAT(log, Contains("1 KARSTResolver: KARSTResolverGenerateNodeLocators:N: Unknown network "
                            "type 7 for interface b0000000-0000-0000-0000-00000000000a"));
}

TEST_F(Locators, SingleAddressCountsWhereTheListIsEmpty) {
  KarstNetInterfaceEntry single = netIfRecord({});
  single.ipv4Address[0] = 192;
  single.ipv4Address[3] = 9;
  putHealth(2, 0);
  putNetIf(2, 2, single);
  EXPECT_THAT(answer(), ElementsAre("192.0.0.9"));
  single.numIpAddresses = 1;
  single.ipAddresses[0].address[0] = 10;
  putNetIf(2, 2, single);
  EXPECT_THAT(answer(), ElementsAre("10.0.0.0")) << "never both";
  putNetIf(2, 2, netIfRecord({}));
  EXPECT_THAT(answer(), IsEmpty());
}

TEST_F(Locators, TrafficTypeOneWhereTheNodeIsAWitness) {
  healthyNetIf(3, {"10.0.0.3"}, 0x1);
  healthyNetIf(4, {"10.0.0.4"}, 0x2);
  healthyNetIf(5, {"10.0.0.5"}, 0x3);
  EXPECT_THAT(answer(), ElementsAre("10.0.0.3", "10.0.0.5"));
  EXPECT_EQ(cachedNode(2)->locators.trafficType, 0u);
  putNode(2, 7, 1, KARST_NODE_FLAG_WITNESS);
  putHealth(3, 1); /* marks the node dirty */
  EXPECT_THAT(answer(), ElementsAre("10.0.0.4", "10.0.0.5"));
  EXPECT_EQ(cachedNode(2)->locators.trafficType, 1u);
}

class WitnessHost : public Cache {
 protected:
  static sim::Settings witness() {
    sim::Settings settings = defaults();
    settings.witness = true;
    return settings;
  }
  WitnessHost() : Cache(witness()) {}
};

TEST_F(WitnessHost, EveryNodeAnswersForTrafficTypeOne) {
  start();
  putSimpleNode(3);
  putNode(2);
  putHealth(4, 0);
  putNetIf(4, 2, {"10.0.0.4"}, 0x1);
  sim.run();
  EXPECT_THAT(nodeLocators(3), ElementsAre("10.0.0.3")) << "names no type: carries all";
  EXPECT_THAT(nodeLocators(2), IsEmpty());
  EXPECT_EQ(cachedNode(2)->locators.trafficType, 1u);
}

}  // namespace
