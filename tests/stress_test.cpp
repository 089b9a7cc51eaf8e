/* The module on real threads. A storm: producers of events, callers, readers and a disturber at
 * once on one resolver, in rounds; after each round all comes to rest, and the cache and every
 * client's answer must be what the directory says. And many loads and unloads while events arrive.
 * Meant for the sanitizers above all. No clock is waited for.
 *
 * Every version and address follows from one counter, so that an answer mixed of two moments is
 * known by itself. What a thread shares is atomic or stays as it was; the module does the rest.
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
#include "host/kernel/heap.h"
#include "karst_resolver/karst_resolver.h"
#include "tests/directory_view.h"

namespace {

using ::testing::IsEmpty;
using Random = std::mt19937;

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

/* clang-format off */
#define KINDS(X)                                                                                 \
  X(NodePut) X(NodeRemoved) X(NetIfPut) X(NetIfRemoved) X(HealthPut) X(HealthRemoved)            \
  X(ObjectPut) X(ObjectRemoved) X(Resync) X(Interruption) X(NodeCreated) X(ObjectCreated)        \
  X(CreateRefused) X(Destroyed) X(Called) X(ReadResolved) X(ReadUnresolved)
/* clang-format on */
#define KIND(name) name,
#define KIND_NAME(name) #name,
enum Kind { KINDS(KIND) Kinds };
const char *const kindNames[] = {KINDS(KIND_NAME)};

std::array<std::atomic<uint64_t>, Kinds> counts{};

void count(Kind kind) {
  counts[kind].fetch_add(1, std::memory_order_relaxed);
}

/* ---- Records that follow from one number ----------------------------------------------------- */

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

/* What a cluster's members put. A node's events are made by one thread at a time. */
struct Source {
  host::Directory &directory;
  std::array<uint32_t, NODES> nodeVersions{};
  std::array<std::array<uint8_t, NETIFS_OF_NODE>, NODES> netIfVersions{};
  std::array<uint64_t, NODES> healthTimes{};

  void putNode(uint32_t node) {
    KarstNodeEntry record{};
    record.majorVersionNum = ++nodeVersions[node];
    record.minorVersionNum = ~record.majorVersionNum;
    directory.put({KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), host::encode(record)});
    count(NodePut);
  }
  void putNetIf(uint32_t node, uint32_t netIf) {
    const uint8_t version = ++netIfVersions[node][netIf];
    KarstNetInterfaceEntry record{};
    record.networkType = KARST_NETWORK_TYPE_IP;
    record.numIpAddresses = addressesOf(version);
    for (uint32_t i = 0; i < record.numIpAddresses; i++) {
      record.ipAddresses[i] = addressOf(node, netIf, i, version);
    }
    directory.put(
        {KARST_TYPE_NET_INTERFACE, netIfUUID(node, netIf), nodeUUID(node), host::encode(record)});
    count(NetIfPut);
  }
  void putHealth(uint32_t node, uint32_t netIf, uint32_t flags) {
    KarstHealthStatusEntry record{};
    record.healthFlags = flags;
    record.timestamp = ++healthTimes[node];
    directory.put(
        {KARST_TYPE_HEALTH_STATUS, netIfUUID(node, netIf), nodeUUID(node), host::encode(record)});
    count(HealthPut);
  }
  void putWholeNode(uint32_t node) {
    putNode(node);
    for (uint32_t netIf = 0; netIf < NETIFS_OF_NODE; netIf++) {
      putNetIf(node, netIf);
      putHealth(node, netIf, 0);
    }
  }
  void putObject(uint32_t object, uint32_t owner) {
    directory.put({OBJECT_TYPE, objectUUID(object), nodeUUID(owner), {0xa0}});
    count(ObjectPut);
  }
  void remove(Kind kind, uint8_t type, const zel_UUID &uuid) {
    directory.remove(type, uuid);
    count(kind);
  }

  /* Every node can be resolved, and every object stands with its first owner. */
  void putEverything() {
    for (uint32_t node = 0; node < NODES; node++) putWholeNode(node);
    for (uint32_t object = 0; object < OBJECTS; object++) putObject(object, object);
    directory.setUsable(true);
  }

  void changeNode(uint32_t node, Random &random) {
    const uint32_t what = random() % 12, netIf = random() % NETIFS_OF_NODE;
    const zel_UUID uuid = netIfUUID(node, netIf);
    if (what == 0) return remove(NodeRemoved, KARST_TYPE_NODE, nodeUUID(node));
    if (what == 1) return remove(NetIfRemoved, KARST_TYPE_NET_INTERFACE, uuid);
    if (what == 2) return remove(HealthRemoved, KARST_TYPE_HEALTH_STATUS, uuid);
    if (what <= 5) return putHealth(node, netIf, what == 3);
    if (what <= 7) return putNode(node);
    putNetIf(node, netIf);
  }

  /* What concerns everybody. */
  void disturb(Random &random) {
    const uint32_t what = random() % 16, object = random() % OBJECTS;
    if (what == 0) return remove(ObjectRemoved, OBJECT_TYPE, objectUUID(object));
    if (what == 1) return directory.resync(), count(Resync);
    if (what == 2) return directory.setUsable(false), count(Interruption);
    if (what <= 5) return directory.setUsable(true);
    putObject(object, what == 6 ? random() % NODES : object);
  }
};

/* ---- Clients --------------------------------------------------------------------------------- */

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

/* The answers of one instance as one thread reads them. */
struct Reader {
  uint32_t version = 0;

  void read(const Resolver &resolver, KARSTResolverInstance *instance) {
    KARSTResolverNodeLocators set;
    std::memset(&set, 0xee, sizeof set);
    set.capacity = KARST_RESOLVER_MAX_LOCATORS;
    if (resolver.read(instance, &set) != ZEL_OK) return count(ReadUnresolved);
    count(ReadResolved);
    const bool local =
        set.count == 1 && set.locators[0].networkType == KARST_RESOLVER_LOCATOR_LOCAL;
    if (!local) checkLocators(set);
    /* This host itself is reached also while its entry, and so its version, is not known: 0.0. */
    if (local && set.majorVersion == 0 && set.minorVersion == 0) return;
    EXPECT_EQ(set.minorVersion, ~set.majorVersion) << "versions of two moments";
    EXPECT_GE(set.majorVersion, version) << "versions went backwards";
    version = set.majorVersion;
  }

 private:
  /* Runs of addresses 0, 1, 2 ... of one interface and one version, whole but for the last one. */
  static void checkLocators(const KARSTResolverNodeLocators &set) {
    ASSERT_LE(set.count, KARST_RESOLVER_MAX_LOCATORS);
    const uint32_t node = set.nodeUUID.bytes[15];
    for (uint16_t at = 0; at < set.count;) {
      const uint8_t netIf = set.locators[at].address[1], version = set.locators[at].address[3];
      for (uint32_t i = 0; i < addressesOf(version) && at < KARST_RESOLVER_MAX_LOCATORS;
           i++, at++) {
        ASSERT_LT(at, set.count) << "an interface's addresses are not all there";
        const KarstIpAddress expected = addressOf(node, netIf, i, version);
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

/* A short life of an instance. */
void callOnce(const Resolver &resolver, Random &random, std::deque<Watcher> &watchers) {
  const uint32_t node = random() % (NODES + 1); /* one that is not there, too */
  const bool object = random() % 2 == 0;
  const zel_UUID hint = object && random() % 2 == 0 ? zel_UUID{} : nodeUUID(node);
  KARSTResolverInstance *instance = nullptr;
  if (resolver.create(&instance, OBJECT_TYPE, object ? objectUUID(random() % OBJECTS) : zel_UUID{},
                      hint, random() % 4 == 0) != ZEL_OK) {
    EXPECT_EQ(instance, nullptr);
    return count(CreateRefused);
  }
  count(object ? ObjectCreated : NodeCreated);
  Watcher &first = watchers.emplace_back();
  Watcher &second = watchers.emplace_back();
  first.slowness = random() % 8 == 0 ? 5000 : 0;
  Reader reader;
  for (Watcher *watcher : {&first, &second}) {
    reader.read(resolver, instance);
    resolver.setCallback(instance, Watcher::told, watcher);
    EXPECT_NE(watcher->state, KARST_RESOLVER_STATE_INIT) << "called before SetCallback returned";
  }
  first.ended = true; /* replaced */
  if (random() % 4 == 0) resolver.setCallback(instance, nullptr, nullptr);
  reader.read(resolver, instance);
  resolver.destroy(instance);
  second.ended = true;
  count(Destroyed);
}

/* ---- The storm ------------------------------------------------------------------------------- */

class Stress : public ::testing::Test {
 protected:
  /* An instance that lives for a round and is read by everybody. */
  struct Kept {
    KARSTResolverInstance *instance = nullptr;
    Watcher watcher;
  };

  Stress() { directory().setSelf(nodeUUID(0)); }
  ~Stress() override { destroyKept(); }

  static host::KernelSettings kernelSettings() {
    host::KernelSettings settings;
    settings.directory.deliveryThreads = 3;
    settings.directory.queueBound = 8; /* overflows */
    settings.tracing.classLevel = 2;
    return settings;
  }

  host::Directory &directory() { return kernel.directory(); }

  void keepInstances() {
    for (uint32_t node = 0; node < NODES; node++) {
      Kept &one = kept.emplace_back();
      one.watcher.slowness = node % 8 == 0 ? 5000 : 0;
      const zel_UUID object = node < OBJECTS ? objectUUID(node) : zel_UUID{};
      ASSERT_EQ(resolver.create(&one.instance, OBJECT_TYPE, object, nodeUUID(node), node == 0),
                ZEL_OK)
          << "node " << node;
      resolver.setCallback(one.instance, Watcher::told, &one.watcher);
    }
  }

  void destroyKept() {
    for (Kept &one : kept) {
      if (one.instance != nullptr) resolver.destroy(one.instance);
      one.watcher.ended = true;
    }
    kernel.settle(); /* the last calls still find the watchers */
    kept.clear();
  }

  void produce(uint32_t thread) {
    Random random(round * 100 + thread);
    for (uint32_t i = 0; i < operations; i++) {
      source.changeNode(random() % (NODES / threads) * threads + thread, random);
    }
  }

  void call(uint32_t thread) {
    Random random(round * 100 + 60 + thread);
    std::deque<Watcher> &mine = watchers[thread];
    for (uint32_t i = 0; i < operations; i++) callOnce(resolver, random, mine);
  }

  void read(uint32_t thread) {
    Random random(round * 100 + 80 + thread);
    std::map<KARSTResolverInstance *, Reader> readers;
    for (uint32_t i = 0; i < operations * 4; i++) {
      KARSTResolverInstance *instance = kept[random() % kept.size()].instance;
      readers[instance].read(resolver, instance);
    }
  }

  void disturb() {
    Random random(round * 100 + 50);
    for (uint32_t i = 0; i < operations; i++) source.disturb(random);
    directory().setUsable(true);
  }

  void storm() {
    std::vector<std::jthread> all;
    for (uint32_t i = 0; i < threads; i++) {
      all.emplace_back([this, i] { produce(i); });
      all.emplace_back([this, i] { call(i); });
      all.emplace_back([this, i] { read(i); });
    }
    all.emplace_back([this] { disturb(); });
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
    for (const Kept &one : kept) held.push_back({one.instance, one.watcher.state});
    const auto *cache = *static_cast<KARSTResolverCache **>(module.anySymbol("karstResolverCache"));
    EXPECT_THAT(differencesOf(cache, viewOf(directory(), nodeUUID(0), false, held)), IsEmpty());
    for (const Kept &one : kept) Reader{}.read(resolver, one.instance);
  }

  void playRound() {
    source.putEverything();
    kernel.settle();
    ASSERT_NO_FATAL_FAILURE(keepInstances());
    storm();
    kernel.settle();
    touchNodes();
    expectDirectorysAnswer();
    destroyKept();
    for (std::deque<Watcher> &some : watchers) some.clear();
    round++;
  }

  const uint32_t operations = setting("KARST_STRESS_OPERATIONS", 300);
  const uint32_t threads = std::clamp(setting("KARST_STRESS_THREADS", 2), 1u, NODES);
  uint32_t round = 0;
  host::Kernel kernel{kernelSettings()};
  host::Module &module = kernel.modules().load(KARST_RESOLVER_SO);
  const Resolver resolver{module};
  Source source{kernel.directory()};
  std::deque<Kept> kept;
  std::vector<std::deque<Watcher>> watchers{threads};
};

TEST_F(Stress, EveryRoundEndsInTheDirectorysAnswer) {
  const std::chrono::seconds duration(setting("KARST_STRESS_SECONDS", 0));
  const auto start = std::chrono::steady_clock::now();
  while ((round < 3 || std::chrono::steady_clock::now() - start < duration) && !HasFailure()) {
    playRound();
  }
  destroyKept(); /* of a round that broke off: the unload would wait for them */
  const uint64_t overflows = directory().overflows();
  kernel.modules().unload(module);
  EXPECT_THAT(kernel.alive(), IsEmpty());

  std::printf("%u rounds, %lu overflows\n", round, overflows);
  EXPECT_GE(overflows, round);
  const uint64_t least = uint64_t{round} * operations / 100;
  for (int kind = 0; kind < Kinds; kind++) {
    std::printf("%10lu  %s\n", counts[kind].load(), kindNames[kind]);
    EXPECT_GE(counts[kind], std::max(least, uint64_t{1})) << kindNames[kind];
  }
}

/* ---- Loads ----------------------------------------------------------------------------------- */

/* Some of them while the directory is usable: in the midst of events or after them, and with
 * instances whose last call is due at the unload, which then polls ten times a second. */
TEST(Loads, AThousandLeaveNothingBehind) {
  host::Kernel kernel;
  kernel.directory().setSelf(nodeUUID(0));
  Source source{kernel.directory()};
  source.putEverything();
  Random random(1);
  const uint64_t before = counts[Destroyed];
  for (uint32_t round = 0; round < 1000; round++) {
    const bool used = round % 20 == 0, amidEvents = round % 40 == 0;
    std::deque<Watcher> watchers;
    std::jthread producer;
    kernel.directory().setUsable(used);
    if (amidEvents) {
      producer = std::jthread([&source, round] {
        for (uint32_t i = 0; i < 20; i++) {
          source.putWholeNode((round + i) % NODES);
          if (i % 7 == 0) source.directory.setUsable(i % 2 == 0);
        }
        source.directory.setUsable(true);
      });
    }
    host::Module &module = kernel.modules().load(KARST_RESOLVER_SO);
    if (used && !amidEvents) kernel.settle();
    for (int i = 0; used && i < 10; i++) callOnce(Resolver(module), random, watchers);
    kernel.modules().unload(module);
    if (producer.joinable()) producer.join();
    ASSERT_THAT(kernel.alive(), IsEmpty());
    ASSERT_THAT(host::heapsAlive(), IsEmpty());
  }
  EXPECT_GT(counts[Destroyed] - before, 50u);
}

}  // namespace
