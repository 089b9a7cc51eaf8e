/* The cache world: order, preemption, and what others may do while it refreshes. */
#include "tests/module_fixture.h"

using sim::Call;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

constexpr uint32_t RESOLVED = KARST_RESOLVER_STATE_RESOLVED;
constexpr uint32_t UNRESOLVED = KARST_RESOLVER_STATE_UNRESOLVED;
const char *const WORLD = "KARSTResolverCache";

class World : public ModuleTest {
 protected:
  void SetUp() override {
    for (uint32_t n : {1, 2, 3}) putSimpleNode(n);
    start();
    traced();
  }
  std::vector<uint32_t> generated() { /* nodes, in the order of their generations */
    std::vector<uint32_t> nodes;
    for (const auto &record : traced({14})) {
      if (record.site == 578) nodes.push_back(record.payload[2] >> 56);
    }
    return nodes;
  }
};

TEST_F(World, WorksOffNodesInOrderEachOnce) {
  sim.hold(WORLD);
  for (uint32_t n : {3, 1, 2, 3, 1}) {
    putHealth(n, sim.uses(Call::KARST_FindEntry) + n * 17 + sim.steps());
    sim.run();
  }
  EXPECT_THAT(generated(), IsEmpty());
  sim.release(WORLD);
  sim.run();
  EXPECT_THAT(generated(), ElementsAre(3, 1, 2));
}

TEST_F(World, ABurstOnOneNodeIsOneRefreshOfAnInstance) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  setCallback(client);
  sim.hold(WORLD);
  for (uint32_t flags = 1; flags < 20; flags++) {
    putHealth(2, flags % 2);
    sim.run();
  }
  sim.release(WORLD);
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED));
  destroy(client);
}

TEST_F(World, SubscribesToHealthBeforeItLooksAtNodes) {
  sim.hold(WORLD);
  putHealth(9, 0);
  putNetIf(9, 3, {"10.0.0.9"});
  sim.run();
  sim.clearHistory();
  traced();
  sim.release(WORLD);
  sim.hold("karst-delivery");
  sim.run();
  auto seen = calls({Call::KARST_Subscribe, Call::TOLM_IsWitnessNode});
  EXPECT_THAT(seen, ElementsAre("KARST_Subscribe", "TOLM_IsWitnessNode"));
}

TEST_F(World, GivesTheLockUpWhenSomebodyIsDue) {
  sim.hold(WORLD);
  for (uint32_t n : {1, 2, 3}) putHealth(n, 1);
  sim.run();
  sim.clearHistory();
  sim.forcePreemption(2);
  sim.release(WORLD);
  sim.run();
  EXPECT_THAT(generated(), ElementsAre(1, 2, 3)) << "nothing is lost on the way";
  size_t locked = calls({Call::zel_SpinlockLock}).size();
  EXPECT_EQ(locked, 3u) << "one cycle, and one more for each time it gave way";
}

TEST_F(World, RefreshesOnlyInstancesOfTheNode) {
  Client two, three;
  ASSERT_EQ(createForNode(two, 2), ZEL_OK);
  ASSERT_EQ(createForNode(three, 3), ZEL_OK);
  setCallback(two);
  setCallback(three);
  putHealth(2, 1);
  sim.run();
  EXPECT_EQ(two.states.size(), 2u);
  EXPECT_EQ(three.states.size(), 1u);
  destroy(two);
  destroy(three);
}

/* The newest first, and after a refresh the order is turned round: each returns to the front. */
TEST_F(World, InstancesReturnToTheFront) {
  std::vector<Client> clients(3);
  std::vector<size_t> order;
  for (size_t i = 0; i < clients.size(); i++) {
    ASSERT_EQ(createForNode(clients[i], 2), ZEL_OK);
    clients[i].duringCallback = [&order, i] { order.push_back(i); };
    setCallback(clients[i]);
  }
  order.clear();
  putHealth(2, 1);
  sim.run();
  EXPECT_THAT(order, ElementsAre(2, 1, 0));
  order.clear();
  putHealth(2, 0);
  sim.run();
  EXPECT_THAT(order, ElementsAre(0, 1, 2));
  for (Client &client : clients) destroy(client);
}

/* The world stops in its first callback; meanwhile another thread destroys the other instance. */
TEST_F(World, InstanceDestroyedWhileOthersAreRefreshedIsNotCalled) {
  Client first, second;
  ASSERT_EQ(createForNode(second, 2), ZEL_OK);
  ASSERT_EQ(createForNode(first, 2), ZEL_OK);
  setCallback(first);
  setCallback(second);
  first.duringCallback = [&] { sim.hold(WORLD); };
  putHealth(2, 1);
  sim.run();
  ASSERT_EQ(first.states.size(), 2u);
  destroy(second);
  sim.release(WORLD);
  sim.run();
  EXPECT_THAT(second.states, ElementsAre(RESOLVED));
  EXPECT_EQ(cachedNode(2)->instanceList.next, &first.instance->nodeLinks);
  first.duringCallback = nullptr;
  destroy(first);
}

/* Destroy waits for the callback that runs, and the world frees the instance when it is through. */
TEST_F(World, InstanceDestroyedDuringItsOwnRefreshIsFreedByTheWorld) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  setCallback(client);
  client.duringCallback = [&] { sim.hold(WORLD); };
  putHealth(2, 1);
  sim.run();
  bool inCallback = true;
  KARSTResolverInstance *instance = client.instance;
  auto destroying = sim.spawn("client", [&] {
    module().function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy")(instance);
    EXPECT_FALSE(inCallback);
  });
  sim.run();
  EXPECT_FALSE(destroying.ended()) << "the callback has the instance's lock";
  inCallback = false;
  traced();
  client.duringCallback = nullptr;
  sim.release(WORLD);
  sim.finish(destroying);
  sim.run();
  auto releases = traced({18});
  ASSERT_EQ(releases.size(), 2u);
  EXPECT_EQ(releases[1].payload[1], 1u);
  EXPECT_EQ(client.states.size(), 2u);
}

/* The node's other references all go while the world refreshes its instance. */
TEST_F(World, NodeThatLosesEverythingDuringItsRefreshLeavesWithTheWorld) {
  Client client;
  ASSERT_EQ(createForNode(client, 3), ZEL_OK);
  setCallback(client);
  client.duringCallback = [&] { sim.hold(WORLD); };
  putHealth(3, 1);
  sim.run();
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(3));
  directory().remove(KARST_TYPE_NODE, nodeUUID(3));
  sim.run();
  auto destroying = sim.spawn("client", [&] {
    module().function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy")(client.instance);
  });
  client.duringCallback = nullptr;
  sim.release(WORLD);
  sim.finish(destroying);
  sim.run();
  EXPECT_EQ(cachedNode(3), nullptr);
  EXPECT_EQ(cache()->dirtyNodes.next, &cache()->dirtyNodes);
}

TEST_F(World, ObjectThatMovesDuringItsRefreshStaysAway) {
  putObject(1, 2);
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  sim.run();
  setCallback(client);
  client.duringCallback = [&] {
    if (client.states.size() == 2) sim.hold(WORLD);
  };
  putHealth(2, 1);
  sim.run();
  ASSERT_EQ(client.states.size(), 2u);
  putObject(1, 3);
  sim.run();
  EXPECT_EQ(client.instance->node, cachedNode(2)) << "tracking waits for the callback to end";
  sim.release(WORLD);
  sim.run();
  EXPECT_EQ(client.instance->node, nullptr);
  EXPECT_EQ(cachedNode(2)->instanceList.next, &cachedNode(2)->instanceList);
  EXPECT_EQ(cachedNode(3)->instanceList.next, &cachedNode(3)->instanceList);
  EXPECT_EQ(client.states.back(), UNRESOLVED);
  destroy(client);
}

TEST_F(World, RefreshForAnotherNodeDoesNothing) {
  Client client;
  ASSERT_EQ(createForNode(client, 2), ZEL_OK);
  setCallback(client);
  traced();
  auto *refresh = internal<void(KARSTResolverInstance *, KARSTResolverNode *)>(
      "KARSTResolverRefreshNodeLocation");
  sim.call("world", [&] { refresh(client.instance, cachedNode(3)); });
  EXPECT_EQ(client.states.size(), 1u);
  EXPECT_THAT(traced(), IsEmpty());
  destroy(client);
}

TEST_F(World, StopsWithoutFurtherWork) {
  sim.hold(WORLD);
  putHealth(2, 1);
  sim.run();
  directory().setUsable(false);
  sim.release(WORLD);
  sim.run();
  EXPECT_EQ(cache()->enabled, 0);
  EXPECT_EQ(cache()->world, ZEL_NO_WORLD);
}

}  // namespace
