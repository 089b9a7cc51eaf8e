/* The whole on real threads: event producers, clients that come and go, readers, the directory's
 * threads and the cache world, all at once; and a thousand loads. Meant to run under the sanitizers
 * too. No clock is waited for: the kernel says when everything has been taken in. */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cstring>
#include <random>
#include <thread>
#include <vector>

#include "host/directory/records.h"
#include "host/host_kernel.h"
#include "host/kernel/heap.h"
#include "karst_resolver/karst_resolver.h"

namespace {

constexpr uint32_t NODES = 12, OBJECTS = 6;
constexpr uint8_t OBJECT_TYPE = 20;

zel_UUID uuidOf(uint8_t kind, uint32_t number) {
  zel_UUID uuid{};
  uuid.bytes[0] = kind;
  uuid.bytes[15] = static_cast<uint8_t>(number);
  return uuid;
}

/* What the directory says, told by one producer for each node. */
struct Producer {
  host::Directory &directory;
  uint32_t node;

  void put(uint32_t version) const {
    KarstNodeEntry record{};
    record.majorVersionNum = version;
    directory.put({KARST_TYPE_NODE, uuidOf(1, node), uuidOf(1, node), host::encode(record)});
    KarstNetInterfaceEntry interface {};
    interface.networkType = KARST_NETWORK_TYPE_IP;
    interface.numIpAddresses = 1 + version % 4;
    for (uint32_t i = 0; i < interface.numIpAddresses; i++) {
      uint8_t *address = interface.ipAddresses[i].address;
      address[0] = 10;
      address[1] = static_cast<uint8_t>(node);
      std::memcpy(address + 2, &version, 2);
    }
    directory.put(
        {KARST_TYPE_NET_INTERFACE, uuidOf(2, node), uuidOf(1, node), host::encode(interface)});
    health(0);
  }
  void health(uint32_t flags) const {
    KarstHealthStatusEntry record{};
    record.healthFlags = flags;
    directory.put(
        {KARST_TYPE_HEALTH_STATUS, uuidOf(2, node), uuidOf(1, node), host::encode(record)});
  }
};

struct Resolver {
  host::Module &module;
  decltype(KARSTResolver_Create) *create =
      module.function<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
  decltype(KARSTResolver_Destroy) *destroy =
      module.function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy");
  decltype(KARSTResolver_SetCallback) *setCallback =
      module.function<decltype(KARSTResolver_SetCallback)>("KARSTResolver_SetCallback");
  decltype(KARSTResolver_GetNodeLocators) *read =
      module.function<decltype(KARSTResolver_GetNodeLocators)>("KARSTResolver_GetNodeLocators");
};

struct Watcher {
  std::atomic<uint64_t> calls{0};
  std::atomic<uint32_t> state{KARST_RESOLVER_STATE_INIT};
  std::atomic<bool> ended{false};
  static void told(void *data, KARSTResolverInstance *, uint32_t state) {
    auto *watcher = static_cast<Watcher *>(data);
    EXPECT_FALSE(watcher->ended) << "a callback after Destroy returned";
    watcher->state = state;
    watcher->calls++;
  }
};

/* One read-out is of one moment: every address carries the node and one and the same version. */
void expectConsistent(const KARSTResolverNodeLocators &set) {
  ASSERT_GE(set.count, 1);
  for (uint16_t i = 0; i < set.count; i++) {
    EXPECT_EQ(set.locators[i].address[1], set.nodeUUID.bytes[15]);
    EXPECT_EQ(std::memcmp(set.locators[i].address, set.locators[0].address, 4), 0);
  }
}

class Whole : public ::testing::Test {
 protected:
  Whole() : resolver{kernel.modules().load(KARST_RESOLVER_SO)} {
    kernel.directory().setSelf(uuidOf(1, 0));
    for (uint32_t n = 0; n < NODES; n++) Producer{kernel.directory(), n}.put(0);
    for (uint32_t n = 0; n < OBJECTS; n++) putObject(n);
    kernel.directory().setUsable(true);
    kernel.settle();
  }
  void putObject(uint32_t object) {
    kernel.directory().put({OBJECT_TYPE, uuidOf(3, object), uuidOf(1, object), {0xa0}});
  }
  KARSTResolverInstance *create(uint32_t node) {
    KARSTResolverInstance *instance = nullptr;
    EXPECT_EQ(resolver.create(&instance, 0, {}, uuidOf(1, node), false), ZEL_OK);
    return instance;
  }

  host::Kernel kernel;
  Resolver resolver;
};

TEST_F(Whole, EverybodyAtOnceEndsInTheDirectorysAnswer) {
  constexpr uint32_t ROUNDS = 150;
  std::vector<KARSTResolverInstance *> kept;
  std::array<Watcher, NODES> watchers;
  for (uint32_t n = 0; n < NODES; n++) {
    kept.push_back(create(n));
    resolver.setCallback(kept.back(), Watcher::told, &watchers[n]);
  }
  std::atomic<bool> producing{true};
  std::atomic<uint64_t> reads{0}, churned{0};
  {
    std::jthread producer([&] {
      std::mt19937 random(1);
      for (uint32_t round = 1; round <= ROUNDS; round++) {
        for (uint32_t n = 0; n < NODES; n++) {
          Producer node{kernel.directory(), n};
          node.put(round);
          if (random() % 3 == 0) node.health(1);
          if (random() % 9 == 0) kernel.directory().remove(KARST_TYPE_NODE, uuidOf(1, n));
        }
        if (round % 20 == 0) kernel.directory().resync();
        if (round % 50 == 0) kernel.directory().setUsable(false);
        if (round % 50 == 5) kernel.directory().setUsable(true);
        uint32_t object = random() % OBJECTS;
        kernel.directory().remove(OBJECT_TYPE, uuidOf(3, object));
        putObject(object);
      }
      kernel.directory().setUsable(true);
      for (uint32_t n = 0; n < NODES; n++) Producer{kernel.directory(), n}.put(ROUNDS);
      producing = false;
    });
    std::jthread reader([&] {
      for (uint32_t n = 0; producing || reads < 1000; n = (n + 1) % NODES) {
        KARSTResolverNodeLocators set{};
        set.capacity = 4;
        if (resolver.read(kept[n], &set) == ZEL_OK) expectConsistent(set);
        reads++;
      }
    });
    std::jthread churner([&] {
      std::mt19937 random(2);
      while (producing || churned < 200) {
        uint32_t n = random();
        bool object = n % 2 == 0;
        KARSTResolverInstance *instance = nullptr;
        Watcher watcher;
        zel_UUID objectUUID = object ? uuidOf(3, n % OBJECTS) : zel_UUID{};
        if (resolver.create(&instance, OBJECT_TYPE, objectUUID, uuidOf(1, n % NODES), n % 3 == 0) ==
            ZEL_OK) {
          resolver.setCallback(instance, Watcher::told, &watcher);
          resolver.destroy(instance);
          watcher.ended = true;
          EXPECT_GE(watcher.calls, 1u);
        }
        churned++;
      }
    });
  }
  kernel.settle();
  for (uint32_t n = 0; n < NODES; n++) {
    KARSTResolverNodeLocators set{};
    set.capacity = 4;
    ASSERT_EQ(resolver.read(kept[n], &set), ZEL_OK) << "node " << n;
    expectConsistent(set);
    EXPECT_EQ(set.majorVersion, ROUNDS);
    EXPECT_EQ(set.count, 1 + ROUNDS % 4);
    uint16_t version;
    std::memcpy(&version, set.locators[0].address + 2, 2);
    EXPECT_EQ(version, ROUNDS);
    EXPECT_EQ(watchers[n].state, KARST_RESOLVER_STATE_RESOLVED) << "the last call's state";
    resolver.destroy(kept[n]);
    watchers[n].ended = true;
  }
}

TEST_F(Whole, UnloadWhileEventsArriveLeavesNothing) {
  kernel.modules().unload(resolver.module);
  for (int round = 0; round < 50; round++) {
    std::jthread producer([&] {
      for (uint32_t i = 0; i < 20; i++) {
        Producer{kernel.directory(), i % NODES}.put(i);
        if (i % 7 == 0) kernel.directory().setUsable(i % 2 == 0);
      }
      kernel.directory().setUsable(true);
    });
    host::Module &module = kernel.modules().load(KARST_RESOLVER_SO);
    Resolver loaded{module};
    KARSTResolverInstance *instance = nullptr;
    if (loaded.create(&instance, OBJECT_TYPE, uuidOf(3, 1), uuidOf(1, 1), true) == ZEL_OK) {
      loaded.destroy(instance); /* its object's last call is still due */
    }
    kernel.modules().unload(module);
  }
  EXPECT_THAT(kernel.alive(), ::testing::IsEmpty());
}

TEST(Loads, AThousandLeaveNothingBehind) {
  host::Kernel kernel;
  kernel.directory().setSelf(uuidOf(1, 0));
  Producer{kernel.directory(), 0}.put(1);
  kernel.directory().setUsable(true);
  for (int round = 0; round < 1000; round++) {
    Resolver resolver{kernel.modules().load(KARST_RESOLVER_SO)};
    if (round % 50 == 0) {
      kernel.settle();
      KARSTResolverInstance *instance = nullptr;
      ASSERT_EQ(resolver.create(&instance, 0, {}, uuidOf(1, 0), false), ZEL_OK);
      resolver.destroy(instance);
    }
    kernel.modules().unload(resolver.module);
    ASSERT_THAT(kernel.alive(), ::testing::IsEmpty());
    ASSERT_THAT(host::heapsAlive(), ::testing::IsEmpty());
  }
}

}  // namespace
