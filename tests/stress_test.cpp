/* The module on real threads. A storm: producers of events, callers, readers and a disturber at
 * once on one resolver, in rounds; after each round all comes to rest, and the cache and every
 * client's answer must be what the directory says. And many loads and unloads while events arrive.
 * Meant for the sanitizers above all. No clock is waited for.
 *
 * A node's versions follow from one counter, so that an answer mixed of two moments is known by
 * itself. What a thread shares is atomic or stays as it was; the module does the rest.
 *
 *   KARST_STRESS_OPERATIONS  of each thread, a round (300)
 *   KARST_STRESS_THREADS     of each kind (2)
 *   KARST_STRESS_SECONDS     rounds go on for so long (0: three rounds)
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <random>
#include <thread>
#include <vector>

#include "host/directory/records.h"
#include "host/host_kernel.h"
#include "host/kernel/heap.h"
#include "karst_resolver/karst_resolver.h"
#include "tests/directory_view.h"
#include "tests/uuids.h"

namespace {

using ::testing::IsEmpty;
using Random = std::mt19937;

constexpr uint32_t NODES = 24, NETIFS = 2 /* of a node */, OBJECTS = 8;

uint32_t setting(const char *name, uint32_t otherwise) {
  const char *text = std::getenv(name);
  return text != nullptr ? static_cast<uint32_t>(std::strtoul(text, nullptr, 10)) : otherwise;
}

/* What is counted, so that a storm in which little happened fails. */
struct Count {
  const char *what;
  std::atomic<uint64_t> times{0};
} created{"instances"}, refused{"creations refused"}, called{"callbacks"}, resolved{"answers"},
    unresolved{"answers that there is none"};

/* ---- Events ---------------------------------------------------------------------------------- */

/* What a cluster's members put. A node's events are made by one thread at a time. */
struct Source {
  host::Directory &directory;
  std::array<uint32_t, NODES> nodeVersions{};
  std::array<uint8_t, NODES * NETIFS> netIfVersions{};

  void putNode(uint32_t node) {
    KarstNodeEntry record{};
    record.majorVersionNum = ++nodeVersions[node];
    record.minorVersionNum = ~record.majorVersionNum;
    directory.put({KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), host::encode(record)});
  }
  void putNetIf(uint32_t netIf) {
    const auto node = static_cast<uint8_t>(netIf / NETIFS), version = ++netIfVersions[netIf];
    KarstNetInterfaceEntry record{};
    record.networkType = KARST_NETWORK_TYPE_IP;
    record.numIpAddresses = 1 + version % 5;
    for (KarstIpAddress &address : record.ipAddresses) {
      address = {0, {}, {10, node, static_cast<uint8_t>(netIf), version}};
    }
    directory.put(
        {KARST_TYPE_NET_INTERFACE, netIfUUID(netIf), nodeUUID(node), host::encode(record)});
  }
  void putHealth(uint32_t netIf, uint32_t flags, uint64_t time = 0) {
    const KarstHealthStatusEntry record{flags, 0, time, 0, 0};
    directory.put({KARST_TYPE_HEALTH_STATUS, netIfUUID(netIf), nodeUUID(netIf / NETIFS),
                   host::encode(record)});
  }
  void putWholeNode(uint32_t node) {
    putNode(node);
    for (uint32_t netIf = node * NETIFS; netIf < (node + 1) * NETIFS; netIf++) {
      putNetIf(netIf);
      putHealth(netIf, 0);
    }
  }
  void putObject(uint32_t object, uint32_t owner) {
    directory.put({objectType, objectUUID(object), nodeUUID(owner), {0xa0}});
  }
  /* Every node can be resolved, and every object stands with its first owner. */
  void putEverything() {
    for (uint32_t node = 0; node < NODES; node++) putWholeNode(node);
    for (uint32_t object = 0; object < OBJECTS; object++) putObject(object, object);
    directory.setUsable(true);
  }

  void changeNode(uint32_t node, Random &random) {
    const uint32_t what = random() % 12, netIf = node * NETIFS + random() % NETIFS;
    if (what == 0) return directory.remove(KARST_TYPE_NODE, nodeUUID(node));
    if (what == 1) return directory.remove(KARST_TYPE_NET_INTERFACE, netIfUUID(netIf));
    if (what == 2) return directory.remove(KARST_TYPE_HEALTH_STATUS, netIfUUID(netIf));
    if (what <= 5) return putHealth(netIf, what == 3, random());
    if (what <= 7) return putNode(node);
    putNetIf(netIf);
  }
  /* What concerns everybody. */
  void disturb(Random &random) {
    const uint32_t what = random() % 16, object = random() % OBJECTS;
    if (what == 0) return directory.remove(objectType, objectUUID(object));
    if (what == 1) return directory.resync();
    if (what <= 5) return directory.setUsable(what != 2);
    putObject(object, what == 6 ? random() % NODES : object);
  }
};

/* ---- Clients --------------------------------------------------------------------------------- */

struct Resolver {
  const host::Module &module;
#define RESOLVER(name) module.function<decltype(KARSTResolver_##name)>("KARSTResolver_" #name)
  decltype(KARSTResolver_Create) *create = RESOLVER(Create);
  decltype(KARSTResolver_Destroy) *destroy = RESOLVER(Destroy);
  decltype(KARSTResolver_SetCallback) *setCallback = RESOLVER(SetCallback);
  decltype(KARSTResolver_GetNodeLocators) *read = RESOLVER(GetNodeLocators);
#undef RESOLVER
};

/* Reads an answer; `last` is the version that this thread has read of the instance before. */
void read(const Resolver &resolver, KARSTResolverInstance *instance, uint32_t &last) {
  KARSTResolverNodeLocators set;
  std::memset(&set, 0xee, sizeof set);
  set.capacity = KARST_RESOLVER_MAX_LOCATORS;
  const bool found = resolver.read(instance, &set) == ZEL_OK;
  (found ? resolved : unresolved).times++;
  /* This host itself is reached also while its entry, and so its version, is not known: 0.0. */
  const bool unknown = set.majorVersion == 0 && set.minorVersion == 0;
  if (!found || (set.nodeUUID == nodeUUID(0) && unknown)) return;
  EXPECT_EQ(set.minorVersion, ~set.majorVersion) << "versions of two moments";
  EXPECT_GE(set.majorVersion, last) << "versions went backwards";
  last = set.majorVersion;
}

/* Somebody who is called. Kept until the round is over, so that a late call finds it. */
struct Watcher {
  explicit Watcher(uint32_t turns = 0) : slowness(turns) {}

  const uint32_t slowness; /* turns that a call makes; it must not sleep */
  std::atomic<bool> ended{false}, running{false};
  std::atomic<uint32_t> state{KARST_RESOLVER_STATE_INIT};
  KARSTResolverInstance *instance = nullptr; /* of one that is called for a whole round */

  static void told(void *data, KARSTResolverInstance *, uint32_t state) {
    auto *watcher = static_cast<Watcher *>(data);
    EXPECT_FALSE(watcher->ended) << "a callback after Destroy returned";
    EXPECT_FALSE(watcher->running.exchange(true)) << "two callbacks of one instance at once";
    for (std::atomic<uint32_t> turn = 0; turn < watcher->slowness;) turn++;
    watcher->state = state;
    watcher->running = false;
    called.times++;
  }
};

/* A short life of an instance. */
void callOnce(const Resolver &resolver, Random &random, std::deque<Watcher> &watchers) {
  const bool object = random() % 2 == 0;
  const uint32_t node = random() % (NODES + 1); /* one that is not there, too */
  KARSTResolverInstance *instance = nullptr;
  const zel_Status status =
      resolver.create(&instance, objectType, object ? objectUUID(random() % OBJECTS) : noUUID,
                      object && random() % 2 == 0 ? noUUID : nodeUUID(node), random() % 4 == 0);
  (status == ZEL_OK ? created : refused).times++;
  ASSERT_EQ(instance != nullptr, status == ZEL_OK);
  if (instance == nullptr) return;
  Watcher &first = watchers.emplace_back(random() % 8 == 0 ? 5000 : 0);
  Watcher &second = watchers.emplace_back();
  uint32_t version = 0;
  for (Watcher *watcher : {&first, &second}) {
    read(resolver, instance, version);
    resolver.setCallback(instance, Watcher::told, watcher);
    EXPECT_NE(watcher->state, KARST_RESOLVER_STATE_INIT) << "called before SetCallback returned";
  }
  first.ended = true; /* replaced */
  if (random() % 4 == 0) resolver.setCallback(instance, nullptr, nullptr);
  read(resolver, instance, version);
  resolver.destroy(instance);
  second.ended = true;
}

/* ---- The storm ------------------------------------------------------------------------------- */

class Stress : public ::testing::Test {
 protected:
  Stress() { directory().setSelf(nodeUUID(0)); }
  ~Stress() override { destroyKept(); }

  static host::KernelSettings kernelSettings() {
    host::KernelSettings settings;
    settings.directory = {.deliveryThreads = 3, .queueBound = 8}; /* overflows */
    settings.tracing.classLevel = 2;
    return settings;
  }

  host::Directory &directory() { return kernel.directory(); }

  void keepInstances() {
    for (uint32_t node = 0; node < NODES; node++) {
      Watcher &one = kept.emplace_back(node % 8 == 0 ? 5000 : 0);
      ASSERT_EQ(
          resolver.create(&one.instance, objectType, node < OBJECTS ? objectUUID(node) : noUUID,
                          nodeUUID(node), node == 0),
          ZEL_OK)
          << "node " << node;
      resolver.setCallback(one.instance, Watcher::told, &one);
    }
  }

  void destroyKept() {
    for (Watcher &one : kept) {
      if (one.instance != nullptr) resolver.destroy(one.instance);
      one.ended = true;
    }
    kernel.settle(); /* the last calls still find the watchers */
    kept.clear();
  }

  void storm() {
    std::vector<std::jthread> all;
    const auto start = [&](auto act) {
      all.emplace_back([this, act, random = Random(seed++)]() mutable {
        for (uint32_t i = 0; i < operations; i++) act(random);
      });
    };
    for (uint32_t thread = 0; thread < threads; thread++) {
      start([this, thread](Random &random) {
        source.changeNode(random() % (NODES / threads) * threads + thread, random);
      });
      start([this, thread](Random &random) { callOnce(resolver, random, watchers[thread]); });
      start([this, versions = std::array<uint32_t, NODES>()](Random &random) mutable {
        for (uint32_t i = 0; i < 4; i++) {
          const uint32_t one = random() % NODES;
          read(resolver, kept[one].instance, versions[one]);
        }
      });
    }
    start([this](Random &random) { source.disturb(random); });
    all.clear();
    directory().setUsable(true);
    kernel.settle();
  }

  /* The version of a node reaches its instances only when something else of it changes. */
  void touchNodes() {
    for (uint32_t node = 0; node < NODES; node++) {
      directory().remove(KARST_TYPE_NODE, nodeUUID(node));
    }
    kernel.settle();
    for (uint32_t node = 0; node < NODES; node++) source.putNode(node);
    kernel.settle();
  }

  void expectDirectorysAnswer() {
    std::vector<HeldInstance> held;
    for (const Watcher &one : kept) held.push_back({one.instance, one.state});
    const auto *cache = *static_cast<KARSTResolverCache **>(module.anySymbol("karstResolverCache"));
    EXPECT_THAT(differencesOf(cache, directory(), held), IsEmpty());
    uint32_t version = 0;
    for (const Watcher &one : kept) read(resolver, one.instance, version = 0);
  }

  void playRound() {
    source.putEverything();
    kernel.settle();
    ASSERT_NO_FATAL_FAILURE(keepInstances());
    storm();
    touchNodes();
    expectDirectorysAnswer();
    destroyKept();
    for (std::deque<Watcher> &some : watchers) some.clear();
  }

  const uint32_t operations = setting("KARST_STRESS_OPERATIONS", 300);
  const uint32_t threads = std::clamp(setting("KARST_STRESS_THREADS", 2), 1u, NODES);
  uint32_t seed = 0;
  host::Kernel kernel{kernelSettings()};
  host::Module &module = kernel.modules().load(KARST_RESOLVER_SO);
  const Resolver resolver{module};
  Source source{kernel.directory()};
  std::deque<Watcher> kept; /* one of each node, read by everybody */
  std::vector<std::deque<Watcher>> watchers{threads};
};

TEST_F(Stress, EveryRoundEndsInTheDirectorysAnswer) {
  const std::chrono::seconds duration(setting("KARST_STRESS_SECONDS", 0));
  const auto start = std::chrono::steady_clock::now();
  uint32_t rounds = 0;
  for (; (rounds < 3 || std::chrono::steady_clock::now() - start < duration) && !HasFailure();
       rounds++) {
    playRound();
  }
  destroyKept(); /* of a round that broke off: the unload would wait for them */
  const uint64_t overflows = directory().overflows();
  kernel.modules().unload(module);
  EXPECT_THAT(kernel.alive(), IsEmpty());

  std::printf("%u rounds, %lu overflows\n", rounds, overflows);
  EXPECT_GE(overflows, rounds);
  for (const Count *count : {&created, &refused, &called, &resolved, &unresolved}) {
    std::printf("%10lu  %s\n", count->times.load(), count->what);
    EXPECT_GE(count->times, uint64_t{rounds} * operations / 100) << count->what;
  }
}

/* ---- Loads ----------------------------------------------------------------------------------- */

/* One of twenty amid events or after them, and with instances whose last call is due at the unload,
 * which then polls ten times a second. */
TEST(Loads, AThousandLeaveNothingBehind) {
  host::Kernel kernel;
  kernel.directory().setSelf(nodeUUID(0));
  Source source{kernel.directory()};
  source.putEverything();
  Random random(1);
  const uint64_t before = created.times;
  for (uint32_t round = 0; round < 1000; round++) {
    const bool used = round % 20 == 0;
    std::deque<Watcher> watchers;
    std::jthread producer;
    kernel.directory().setUsable(used);
    if (used) {
      producer = std::jthread([&source, round] {
        for (uint32_t i = 0; i < 20; i++) {
          source.putWholeNode((round + i) % NODES);
          if (i % 7 == 0) source.directory.setUsable(i % 2 == 0);
        }
        source.directory.setUsable(true);
      });
    }
    host::Module &module = kernel.modules().load(KARST_RESOLVER_SO);
    if (round % 40 == 0) { /* after the events instead */
      producer = {};
      kernel.settle();
    }
    for (int i = 0; used && i < 10; i++) callOnce(Resolver{module}, random, watchers);
    kernel.modules().unload(module);
    producer = {}; /* which joins it */
    ASSERT_THAT(kernel.alive(), IsEmpty());
    ASSERT_THAT(host::heapsAlive(), IsEmpty());
  }
  EXPECT_GT(created.times - before, 50u);
}

}  // namespace
