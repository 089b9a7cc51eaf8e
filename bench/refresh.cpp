/* What one of many instances of a node costs when the node's locators have changed, and to make and to
 * end; beside one signal with as many slots and a list of functions under a mutex. */
#include <boost/intrusive/list.hpp>
#include <boost/signals2.hpp>
#include <cstring>
#include <functional>
#include <memory>
#include <mutex>

#include "bench/kept.h"
#include "bench/subjects.h"
#include "karst_resolver/trace.h"

namespace bench {
namespace {

enum : uint8_t { FIRST_NODE = 10, QUIET_NODE = 20 };

double seconds(Clock::duration duration) {
  return std::chrono::duration<double>(duration).count();
}

/* ---- Refresh --------------------------------------------------------------------------------- */

/* The walk alone, from the first callback to the last: the hand-offs before it are no part of what an
 * instance costs. */
void refresh(benchmark::State &state, Cluster &cluster, uint8_t number, size_t instances) {
  WatchedNode node(cluster, number, instances);
  const OthersPinned pinned(1); /* the client waits on the other one */
  state.counters[ITEMS] = static_cast<double>(node.instances() - 1);
  for (auto _ : state) {
    Clock::time_point start;
    if (!node.change(&start)) return state.SkipWithError("not each called once");
    state.SetIterationTime(seconds(node.span()));
  }
}

/* A walk of one has no second callback to measure to: what the world calls for each instance, called
 * directly. */
void refreshOne(benchmark::State &state, Cluster &cluster, uint8_t number) {
  const WatchedNode watched(cluster, number, 1);
  auto *find = cluster.inModule<void *(void *cache, zel_UUID uuid)>("KARSTResolverFindNodeLocked");
  auto *refreshLocation = cluster.inModule<void(KARSTResolverInstance *, void *node)>(
      "KARSTResolverRefreshNodeLocation");
  void *cache = *cluster.inModule<void *>("karstResolverCache");
  void *node = find(cache, nodeUUID(number)); /* all is idle: nobody needs the lock */
  const uint64_t before = watched.calls();
  for (auto _ : state) refreshLocation(watched.instance(), node);
  if (watched.calls() != before + state.iterations()) state.SkipWithError("not called each time");
}

/* Keeps a copy of what it is told, as an instance does, and does what the instances' callback does. */
struct Observer {
  void told(const KARSTResolverNodeLocators &locators) {
    kept = locators;
    calls->store(calls->load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
  }
  KARSTResolverNodeLocators kept{};
  std::atomic<uint64_t> *calls = nullptr;
};

struct Observers {
  explicit Observers(size_t count) : each(count) {
    for (Observer &observer : each) observer.calls = &calls;
  }
  std::atomic<uint64_t> calls{0};
  std::vector<Observer> each;
};

/* One emission. */
class Signal {
 public:
  static constexpr const char *NAME = "boost::signals2";
  explicit Signal(size_t observers) : observers_(observers) {
    for (Observer &observer : observers_.each) connect(observer);
  }
  void connect(Observer &observer) {
    signal_.connect([&observer](const KARSTResolverNodeLocators &told) { observer.told(told); });
  }
  void tell(const KARSTResolverNodeLocators &locators) { signal_(locators); }

 private:
  Observers observers_;
  boost::signals2::signal<void(const KARSTResolverNodeLocators &)> signal_;
};

/* One lock for all, held across all calls. */
class Functions {
 public:
  static constexpr const char *NAME = "functions called under a mutex";
  explicit Functions(size_t observers) : observers_(observers) {
    for (Observer &observer : observers_.each) {
      functions_.emplace_back(
          [&observer](const KARSTResolverNodeLocators &told) { observer.told(told); });
    }
  }
  void tell(const KARSTResolverNodeLocators &locators) {
    const std::lock_guard lock(mutex_);
    for (const auto &function : functions_) function(locators);
  }

 private:
  Observers observers_;
  std::mutex mutex_;
  std::vector<std::function<void(const KARSTResolverNodeLocators &)>> functions_;
};

/* The bytes alone. */
class Stores {
 public:
  static inline const std::string NAME = limit("stores");
  explicit Stores(size_t observers) : kept_(observers) {}
  void tell(const KARSTResolverNodeLocators &locators) {
    for (KARSTResolverNodeLocators &kept : kept_) {
      kept = locators;
      benchmark::DoNotOptimize(&kept);
    }
    benchmark::ClobberMemory();
  }

 private:
  std::vector<KARSTResolverNodeLocators> kept_;
};

/* What a refresh must do whatever surrounds it: the locks are taken four times, the cache's for the copy
 * and for the walk, the instance's for the copy and for the call, and one reference taken and given back.
 * Six exchanges that nothing contends for, and the bytes. */
template <typename Lock>
class LockedStores {
 public:
  static inline const std::string NAME = limit("stores, six exchanges");
  explicit LockedStores(size_t observers) {
    for (size_t i = 0; i < observers; i++) kept_.push_back(std::make_unique<Kept>());
  }
  void tell(const KARSTResolverNodeLocators &locators) {
    for (const auto &kept : kept_) tell(*kept, locators);
  }

 protected:
  /* As large as an instance with its lock's block, and what is touched as far apart. */
  struct Kept : boost::intrusive::list_base_hook<> {
    std::atomic<uint64_t> references{1};
    std::byte name[184];
    KARSTResolverNodeLocators locators;
    std::byte header[96];
    Lock lock;
    std::byte rest[148];
  };
  static_assert(sizeof(Kept) == 592);

  void tell(Kept &kept, const KARSTResolverNodeLocators &locators) {
    kept.references.fetch_add(1, std::memory_order_relaxed);
    kept.locators = locators;
    for (Lock *lock : {&cache_, &kept.lock, &kept.lock, &cache_}) {
      lock->lock();
      benchmark::DoNotOptimize(&kept);
      lock->unlock();
    }
    kept.references.fetch_sub(1, std::memory_order_relaxed);
  }

  Lock cache_;
  std::vector<std::unique_ptr<Kept>> kept_; /* made one by one, as instances are */
};

/* The same with the calls that a module cannot do without, of the locks, of its client, and of the three
 * trace statements that ask whether their class is on; and from list to list, since who leaves while the
 * cache's lock is given up must not end the walk. */
class CalledStores : LockedStores<OneExchangeCalled> {
 public:
  static inline const std::string NAME = limit("six exchanges, calls, lists");
  explicit CalledStores(size_t observers) : LockedStores(observers) {
    for (const auto &kept : kept_) list_.push_front(*kept);
  }
  ~CalledStores() { list_.clear(); }
  CalledStores(const CalledStores &) = delete;
  CalledStores &operator=(const CalledStores &) = delete;

  void tell(const KARSTResolverNodeLocators &locators) {
    List pending;
    pending.swap(list_);
    while (!pending.empty()) {
      Kept &kept = pending.front();
      LockedStores::tell(kept, locators);
      client_(&calls_);
      for (int statement = 0; statement < 3; statement++) {
        benchmark::DoNotOptimize(Trace_ClassLevelGet(KARST_RESOLVER_TRACE_CLASS_InvokeCallback));
      }
      pending.pop_front();
      list_.push_front(kept);
    }
  }

 private:
  static void count(std::atomic<uint64_t> *calls) {
    calls->store(calls->load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
  }
  using List = boost::intrusive::list<Kept, boost::intrusive::constant_time_size<false>>;
  List list_;
  std::atomic<uint64_t> calls_{0};
  void (*volatile client_)(std::atomic<uint64_t> *calls) = count;
};

template <typename Peer>
void measureTelling(const std::string &work, size_t observers) {
  measure({work, Peer::NAME}, [=](benchmark::State &state) {
    Peer peer(observers);
    KARSTResolverNodeLocators locators{};
    state.counters[ITEMS] = static_cast<double>(observers);
    for (auto _ : state) {
      locators.majorVersion++;
      peer.tell(locators);
    }
  });
}

void measureRefresh(Cluster &cluster) {
  uint8_t number = FIRST_NODE;
  for (const size_t instances : {1, 128, 10'000, 100'000}) {
    const std::string work = "refresh an instance of " + std::to_string(instances);
    if (instances == 1) {
      measure({work}, [=, &cluster](auto &state) { refreshOne(state, cluster, number); });
    } else {
      measure({work}, [=, &cluster](auto &state) {
        refresh(state, cluster, number, instances);
      })->UseManualTime();
    }
    measureTelling<Signal>(work, instances);
    measureTelling<Functions>(work, instances);
    measureTelling<Stores>(work, instances);
    measureTelling<LockedStores<OneExchange>>(work, instances);
    measureTelling<CalledStores>(work, instances);
    number++;
  }
  for (const size_t instances : {128, 10'000}) {
    const std::string work = "refresh an instance of " + std::to_string(instances);
    ask(work, 0.4, {Signal::NAME});
    nameFloor(work, CalledStores::NAME);
  }
  const Bar flat{"one of 100000 refreshed, against one of 128",
                 {"refresh an instance of 100000"},
                 1.3,
                 {{"refresh an instance of 128"}}};
  ask(flat);
  Bar floor = flat;
  for (const Subject &ours : {flat.peers.front(), flat.ours}) {
    floor.growth.push_back({ours.work, CalledStores::NAME});
  }
  nameFloor(floor);
}

/* ---- One event among many -------------------------------------------------------------------- */

/* The directory is full; the node has one instance, and others have all the rest. */
void eventAmongMany(benchmark::State &state, Cluster &cluster) {
  WatchedNode node(cluster, QUIET_NODE, 1);
  const WatchedNode elsewhere(cluster, QUIET_NODE + 1, 10'000);
  const OthersPinned pinned(0);
  const uint64_t before = elsewhere.calls();
  for (auto _ : state) {
    Clock::time_point start;
    if (!node.change(&start)) return state.SkipWithError("not one call for one change");
    state.SetIterationTime(seconds(node.lastCall() - start));
  }
  askCount("instances of other nodes that an event touches", elsewhere.calls() - before, 0);
}

/* ---- Create and destroy ---------------------------------------------------------------------- */

void createAndDestroy(benchmark::State &state, Cluster &cluster) {
  for (auto _ : state) {
    KARSTResolverInstance *instance = nullptr;
    if (cluster.create(&instance, 0, zel_UUID{}, nodeUUID(QUIET_NODE), false) != ZEL_OK) {
      return state.SkipWithError("an instance cannot be made");
    }
    cluster.destroy(instance);
  }
}

void connectAndDisconnect(benchmark::State &state) {
  boost::signals2::signal<void(const KARSTResolverNodeLocators &)> signal;
  for (auto _ : state) {
    Observers observers(1);
    Observer *observer = &observers.each.front();
    signal.connect([=](const KARSTResolverNodeLocators &told) { observer->told(told); })
        .disconnect();
  }
}

}  // namespace

void measureRefreshes(Cluster &cluster) {
  measureRefresh(cluster);
  measure({"change to callback, 10000 elsewhere"}, [&cluster](auto &state) {
    eventAmongMany(state, cluster);
  })->UseManualTime();
  const std::string work = "create and destroy an instance";
  measure({work}, [&cluster](auto &state) { createAndDestroy(state, cluster); });
  measure({work, Signal::NAME}, connectAndDisconnect);
}

}  // namespace bench
