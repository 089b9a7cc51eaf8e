/* A storm on real threads: producers of events, callers, readers and a disturber at once on one resolver,
 * in rounds. After each round all comes to rest, and the cache and every client's answer must be what
 * the directory says. Meant for the sanitizers above all. No clock is waited for.
 *
 * Every version and address follows from one counter, so that an answer mixed of two moments is known
 * by itself. What a thread shares is atomic or stays as it was made; the module does the rest.
 *
 *   KARST_STRESS_OPERATIONS  of each thread, a round (300)
 *   KARST_STRESS_THREADS     of each kind (2)
 *   KARST_STRESS_SECONDS     rounds go on for so long (0: three rounds)
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <map>
#include <random>
#include <thread>
#include <vector>

#include "host/directory/records.h"
#include "host/host_kernel.h"
#include "karst_resolver/karst_resolver.h"
#include "tests/directory_view.h"

namespace {

constexpr uint32_t NODES = 24, NETIFS_OF_NODE = 2, OBJECTS = 8;
constexpr uint8_t OBJECT_TYPE = 20;

uint32_t setting(const char *name, uint32_t otherwise) {
  const char *text = std::getenv(name);
  return text != nullptr ? static_cast<uint32_t>(std::strtoul(text, nullptr, 10)) : otherwise;
}

zel_UUID uuidOf(uint8_t kind, uint32_t number) {
  zel_UUID uuid{};
  uuid.bytes[0] = kind;
  uuid.bytes[15] = static_cast<uint8_t>(number);
  return uuid;
}
zel_UUID nodeUUID(uint32_t node) {
  return uuidOf(1, node);
}
zel_UUID netIfUUID(uint32_t node, uint32_t netIf) {
  return uuidOf(2, node * NETIFS_OF_NODE + netIf);
}
zel_UUID objectUUID(uint32_t object) {
  return uuidOf(3, object);
}

/* ---- What is counted ------------------------------------------------------------------------- */

enum Kind {
  NodePut,
  NodeRemoved,
  NetIfPut,
  NetIfRemoved,
  HealthPut,
  HealthRemoved,
  ObjectPut,
  ObjectRemoved,
  Resync,
  Interruption,
  NodeCreated,
  ObjectCreated,
  CreateRefused,
  CallbackSet,
  Destroyed,
  Called,
  ReadResolved,
  ReadUnresolved,
  Kinds
};
const char *const kindNames[] = {
    "node put",       "node removed",   "netif put",       "netif removed", "health put",
    "health removed", "object put",     "object removed",  "resync",        "interruption",
    "node created",   "object created", "create refused",  "callback set",  "destroyed",
    "callback",       "read resolved",  "read unresolved",
};
static_assert(std::size(kindNames) == Kinds);

std::array<std::atomic<uint64_t>, Kinds> counts{};

void count(Kind kind) {
  counts[kind].fetch_add(1, std::memory_order_relaxed);
}

/* ---- Records that follow from one number ----------------------------------------------------- */

KarstNodeEntry nodeRecord(uint32_t version) {
  KarstNodeEntry record{};
  record.majorVersionNum = version;
  record.minorVersionNum = ~version;
  return record;
}

/* Byte by byte: the node, the interface, which address of how many, the version; of an IPv6
 * address the same four times, each time with the version turned over. */
KarstIpAddress addressOf(uint32_t node, uint32_t netIf, uint32_t index, uint8_t version) {
  KarstIpAddress address{};
  address.isIPv6 = version % 2;
  for (uint32_t i = 0; i < (address.isIPv6 ? 4u : 1u); i++) {
    const uint8_t turned = i % 2 == 0 ? version : static_cast<uint8_t>(~version);
    const uint8_t bytes[] = {static_cast<uint8_t>(10 + node), static_cast<uint8_t>(netIf),
                             static_cast<uint8_t>(index), turned};
    std::memcpy(address.address + i * sizeof bytes, bytes, sizeof bytes);
  }
  return address;
}

uint32_t addressesOf(uint8_t version) {
  return 1 + version % 5;
}

KarstNetInterfaceEntry netIfRecord(uint32_t node, uint32_t netIf, uint8_t version) {
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  record.numIpAddresses = addressesOf(version);
  for (uint32_t i = 0; i < record.numIpAddresses; i++) {
    record.ipAddresses[i] = addressOf(node, netIf, i, version);
  }
  return record;
}

/* ---- What a reader has seen ------------------------------------------------------------------ */

/* The answers of one instance as one thread reads them. */
struct Reader {
  uint32_t version = 0;

  void read(decltype(KARSTResolver_GetNodeLocators) *getNodeLocators,
            KARSTResolverInstance *instance) {
    KARSTResolverNodeLocators set;
    std::memset(&set, 0xee, sizeof set);
    set.capacity = KARST_RESOLVER_MAX_LOCATORS;
    if (getNodeLocators(instance, &set) != ZEL_OK) {
      count(ReadUnresolved);
      return;
    }
    count(ReadResolved);
    checkVersion(set);
    checkLocators(set);
  }

 private:
  static bool isLocal(const KARSTResolverNodeLocators &set) {
    return set.count == 1 && set.locators[0].networkType == KARST_RESOLVER_LOCATOR_LOCAL;
  }

  /* This host itself is reached also while its entry, and so its version, is not known: 0.0. */
  void checkVersion(const KARSTResolverNodeLocators &set) {
    if (isLocal(set) && set.majorVersion == 0 && set.minorVersion == 0) return;
    EXPECT_EQ(set.minorVersion, ~set.majorVersion) << "versions of two moments";
    EXPECT_GE(set.majorVersion, version) << "versions went backwards";
    version = set.majorVersion;
  }

  /* Runs of addresses 0, 1, 2 ... of one interface and one version, whole but for the last one. */
  static void checkLocators(const KARSTResolverNodeLocators &set) {
    if (isLocal(set)) return;
    ASSERT_LE(set.count, KARST_RESOLVER_MAX_LOCATORS);
    const uint32_t node = set.nodeUUID.bytes[15];
    for (uint16_t at = 0; at < set.count;) {
      const uint8_t netIf = set.locators[at].address[1];
      const uint8_t netIfVersion = set.locators[at].address[3];
      const uint32_t addresses = addressesOf(netIfVersion);
      for (uint32_t i = 0; i < addresses && at < KARST_RESOLVER_MAX_LOCATORS; i++, at++) {
        ASSERT_LT(at, set.count) << "an interface's addresses are not all there";
        const KarstIpAddress expected = addressOf(node, netIf, i, netIfVersion);
        const KARSTResolverNodeLocator &locator = set.locators[at];
        ASSERT_EQ(locator.networkType,
                  expected.isIPv6 ? KARST_RESOLVER_LOCATOR_IPV6 : KARST_RESOLVER_LOCATOR_IPV4);
        ASSERT_EQ(std::memcmp(locator.address, expected.address, expected.isIPv6 ? 16 : 4), 0)
            << "addresses of two moments";
      }
    }
  }
};

/* Somebody who is called. Kept until the round is over, so that a late call finds it. */
struct Watcher {
  std::atomic<bool> ended{false};
  std::atomic<bool> running{false};
  std::atomic<uint32_t> state{KARST_RESOLVER_STATE_INIT};
  uint32_t slowness = 0; /* turns that a call makes; it must not sleep */

  static void told(void *data, KARSTResolverInstance *, uint32_t state) {
    auto *watcher = static_cast<Watcher *>(data);
    EXPECT_FALSE(watcher->ended) << "a callback after Destroy returned";
    EXPECT_FALSE(watcher->running.exchange(true)) << "two callbacks of one instance at once";
    for (std::atomic<uint32_t> turn = 0; turn < watcher->slowness;) turn++;
    watcher->state = state;
    watcher->running = false;
    count(Called);
  }
};

/* ---- The storm ------------------------------------------------------------------------------- */

class Stress : public ::testing::Test {
 protected:
  using Random = std::mt19937;

  struct Resolver {
    explicit Resolver(const host::Module &module)
        : create(module.function<decltype(KARSTResolver_Create)>("KARSTResolver_Create")),
          destroy(module.function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy")),
          setCallback(
              module.function<decltype(KARSTResolver_SetCallback)>("KARSTResolver_SetCallback")),
          read(module.function<decltype(KARSTResolver_GetNodeLocators)>(
              "KARSTResolver_GetNodeLocators")) {}
    decltype(KARSTResolver_Create) *create;
    decltype(KARSTResolver_Destroy) *destroy;
    decltype(KARSTResolver_SetCallback) *setCallback;
    decltype(KARSTResolver_GetNodeLocators) *read;
  };

  /* An instance that lives for a round and is read by everybody. */
  struct Kept {
    KARSTResolverInstance *instance = nullptr;
    Watcher watcher;
  };

  Stress() : module(kernel.modules().load(KARST_RESOLVER_SO)), resolver(module) {
    directory().setSelf(nodeUUID(0));
  }

  ~Stress() override { destroyKept(); }

  static host::KernelSettings kernelSettings() {
    host::KernelSettings settings;
    settings.directory.deliveryThreads = 3;
    settings.directory.queueBound = 8; /* overflows */
    settings.tracing.classLevel = 2;
    return settings;
  }

  host::Directory &directory() { return kernel.directory(); }

  /* ---- Events; a node's are made by one thread at a time. ---- */

  void putNode(uint32_t node) {
    const KarstNodeEntry record = nodeRecord(++nodeVersions[node]);
    directory().put({KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), host::encode(record)});
    count(NodePut);
  }
  void putNetIf(uint32_t node, uint32_t netIf) {
    const uint8_t version = ++netIfVersions[node][netIf];
    directory().put({KARST_TYPE_NET_INTERFACE, netIfUUID(node, netIf), nodeUUID(node),
                     host::encode(netIfRecord(node, netIf, version))});
    count(NetIfPut);
  }
  void putHealth(uint32_t node, uint32_t netIf, uint32_t flags) {
    KarstHealthStatusEntry record{};
    record.healthFlags = flags;
    record.timestamp = ++healthTimes[node];
    directory().put(
        {KARST_TYPE_HEALTH_STATUS, netIfUUID(node, netIf), nodeUUID(node), host::encode(record)});
    count(HealthPut);
  }
  void remove(Kind kind, uint8_t type, const zel_UUID &uuid) {
    directory().remove(type, uuid);
    count(kind);
  }
  void putObject(uint32_t object, uint32_t owner) {
    directory().put({OBJECT_TYPE, objectUUID(object), nodeUUID(owner), {0xa0}});
    count(ObjectPut);
  }
  void putWholeNode(uint32_t node) {
    putNode(node);
    for (uint32_t netIf = 0; netIf < NETIFS_OF_NODE; netIf++) {
      putNetIf(node, netIf);
      putHealth(node, netIf, 0);
    }
  }

  void changeSomething(uint32_t node, Random &random) {
    const uint32_t netIf = random() % NETIFS_OF_NODE;
    const zel_UUID uuid = netIfUUID(node, netIf);
    switch (random() % 12) {
      case 0:
        return remove(NodeRemoved, KARST_TYPE_NODE, nodeUUID(node));
      case 1:
        return remove(NetIfRemoved, KARST_TYPE_NET_INTERFACE, uuid);
      case 2:
        return remove(HealthRemoved, KARST_TYPE_HEALTH_STATUS, uuid);
      case 3:
        return putHealth(node, netIf, 1);
      case 4:
      case 5:
        return putHealth(node, netIf, 0);
      case 6:
      case 7:
        return putNode(node);
      default:
        return putNetIf(node, netIf);
    }
  }

  void produce(uint32_t thread) {
    Random random(round * 100 + thread);
    for (uint32_t i = 0; i < operations; i++) {
      const uint32_t node = random() % (NODES / threads) * threads + thread;
      changeSomething(node, random);
    }
  }

  /* What concerns everybody. */
  void disturb() {
    Random random(round * 100 + 50);
    for (uint32_t i = 0; i < operations; i++) {
      const uint32_t object = random() % OBJECTS;
      switch (random() % 16) {
        case 0:
          remove(ObjectRemoved, OBJECT_TYPE, objectUUID(object));
          break;
        case 1:
          directory().resync();
          count(Resync);
          break;
        case 2:
          directory().setUsable(false);
          count(Interruption);
          break;
        case 3:
        case 4:
        case 5:
          directory().setUsable(true);
          break;
        case 6:
          putObject(object, random() % NODES);
          break;
        default:
          putObject(object, object);
          break;
      }
    }
    directory().setUsable(true);
  }

  /* ---- Clients ---- */

  void callOnce(Random &random, std::deque<Watcher> &watchers) {
    const uint32_t node = random() % (NODES + 1); /* one that is not there, too */
    const bool object = random() % 2 == 0;
    const zel_UUID hint = object && random() % 2 == 0 ? zel_UUID{} : nodeUUID(node);
    KARSTResolverInstance *instance = nullptr;
    if (resolver.create(&instance, OBJECT_TYPE,
                        object ? objectUUID(random() % OBJECTS) : zel_UUID{}, hint,
                        random() % 4 == 0) != ZEL_OK) {
      EXPECT_EQ(instance, nullptr);
      count(CreateRefused);
      return;
    }
    count(object ? ObjectCreated : NodeCreated);
    Watcher &first = watchers.emplace_back();
    Watcher &second = watchers.emplace_back();
    first.slowness = random() % 8 == 0 ? 5000 : 0;
    Reader reader;
    for (Watcher *watcher : {&first, &second}) {
      reader.read(resolver.read, instance);
      resolver.setCallback(instance, Watcher::told, watcher);
      count(CallbackSet);
      EXPECT_NE(watcher->state, KARST_RESOLVER_STATE_INIT) << "called before SetCallback returned";
    }
    first.ended = true; /* replaced */
    if (random() % 4 == 0) resolver.setCallback(instance, nullptr, nullptr);
    reader.read(resolver.read, instance);
    resolver.destroy(instance);
    second.ended = true;
    count(Destroyed);
  }

  void callersWork(uint32_t thread, std::deque<Watcher> &watchers) {
    Random random(round * 100 + 60 + thread);
    for (uint32_t i = 0; i < operations; i++) callOnce(random, watchers);
  }

  void readersWork(uint32_t thread) {
    Random random(round * 100 + 80 + thread);
    std::map<KARSTResolverInstance *, Reader> readers;
    for (uint32_t i = 0; i < operations * 4; i++) {
      KARSTResolverInstance *instance = kept[random() % kept.size()].instance;
      readers[instance].read(resolver.read, instance);
    }
  }

  /* ---- Rounds ---- */

  /* Every node can be resolved, and every object stands with its first owner. */
  void putEverything() {
    for (uint32_t node = 0; node < NODES; node++) putWholeNode(node);
    for (uint32_t object = 0; object < OBJECTS; object++) putObject(object, object);
    directory().setUsable(true);
    kernel.settle();
  }

  void destroyKept() {
    for (Kept &one : kept) {
      if (one.instance != nullptr) resolver.destroy(one.instance);
      one.instance = nullptr;
      one.watcher.ended = true;
    }
  }

  void keepInstances() {
    kept.clear();
    for (uint32_t node = 0; node < NODES; node++) {
      Kept &one = kept.emplace_back();
      one.watcher.slowness = node % 8 == 0 ? 5000 : 0;
      const bool object = node < OBJECTS;
      ASSERT_EQ(resolver.create(&one.instance, OBJECT_TYPE, object ? objectUUID(node) : zel_UUID{},
                                nodeUUID(node), node == 0),
                ZEL_OK)
          << "node " << node;
      resolver.setCallback(one.instance, Watcher::told, &one.watcher);
    }
  }

  void storm() {
    std::deque<std::deque<Watcher>> watchers(threads);
    {
      std::vector<std::jthread> all;
      for (uint32_t i = 0; i < threads; i++) {
        all.emplace_back([this, i] { produce(i); });
        all.emplace_back([this, i, &watchers] { callersWork(i, watchers[i]); });
        all.emplace_back([this, i] { readersWork(i); });
      }
      all.emplace_back([this] { disturb(); });
    }
    kernel.settle();
  }

  /* What the module is not told by itself: the version of a node, when nothing else changes, and that
   * a health entry went between an interface's first reading of it and its subscription. So every
   * node goes and comes back, and so does, the other way round, every health entry that is gone. */
  void touchEverything() {
    for (uint32_t node = 0; node < NODES; node++) {
      directory().remove(KARST_TYPE_NODE, nodeUUID(node));
      for (uint32_t netIf = 0; netIf < NETIFS_OF_NODE; netIf++) {
        const zel_UUID uuid = netIfUUID(node, netIf);
        if (directory().entry(KARST_TYPE_HEALTH_STATUS, uuid)) continue;
        putHealth(node, netIf, 1);
        remove(HealthRemoved, KARST_TYPE_HEALTH_STATUS, uuid);
      }
    }
    kernel.settle();
    for (uint32_t node = 0; node < NODES; node++) putNode(node);
    kernel.settle();
  }

  void expectDirectorysAnswer() {
    std::vector<HeldInstance> held;
    for (const Kept &one : kept) held.push_back({one.instance, one.watcher.state});
    const auto *cache = *static_cast<KARSTResolverCache **>(module.anySymbol("karstResolverCache"));
    EXPECT_THAT(differencesOf(cache, viewOf(directory(), nodeUUID(0), false, held)),
                ::testing::IsEmpty());
    for (const Kept &one : kept) Reader{}.read(resolver.read, one.instance);
  }

  void playRound() {
    putEverything();
    ASSERT_NO_FATAL_FAILURE(keepInstances());
    storm();
    touchEverything();
    expectDirectorysAnswer();
    destroyKept();
    kernel.settle();
    round++;
  }

  const uint32_t operations = setting("KARST_STRESS_OPERATIONS", 300);
  const uint32_t threads = std::clamp(setting("KARST_STRESS_THREADS", 2), 1u, NODES);
  uint32_t round = 0;
  std::array<uint32_t, NODES> nodeVersions{};
  std::array<std::array<uint8_t, NETIFS_OF_NODE>, NODES> netIfVersions{};
  std::array<uint64_t, NODES> healthTimes{};
  host::Kernel kernel{kernelSettings()};
  host::Module &module;
  Resolver resolver;
  std::deque<Kept> kept;
};

TEST_F(Stress, EveryRoundEndsInTheDirectorysAnswer) {
  const std::chrono::seconds duration(setting("KARST_STRESS_SECONDS", 0));
  const auto start = std::chrono::steady_clock::now();
  while ((round < 3 || std::chrono::steady_clock::now() - start < duration) && !HasFailure()) {
    playRound();
  }
  const uint64_t overflows = directory().overflows();
  kernel.modules().unload(module);
  EXPECT_THAT(kernel.alive(), ::testing::IsEmpty());

  std::printf("%u rounds, %lu overflows\n", round, overflows);
  EXPECT_GE(overflows, round);
  const uint64_t least = uint64_t{round} * operations / 100;
  for (int kind = 0; kind < Kinds; kind++) {
    std::printf("%10lu  %s\n", counts[kind].load(), kindNames[kind]);
    EXPECT_GE(counts[kind], std::max(least, uint64_t{1})) << kindNames[kind];
  }
}

}  // namespace
