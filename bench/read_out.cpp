/* What a client does most, in the loaded module: reading the locators out, alone, beside a writer and
 * among other readers, next to the same bytes kept in other ways (kept.h); and the host's spinlock,
 * which each reading takes.
 *
 * Our writer is the module's own refresh of the instance, called from here, for the way through the
 * directory is too long for ten thousand a second: it takes the cache lock, then the instance lock to
 * copy the node's locators, then the instance lock again to call the client. */
#include <immintrin.h>
#include <netdb.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <optional>
#include <thread>

#include "bench/kept.h"
#include "bench/subjects.h"
#include "karst_resolver/instance.h"

namespace bench {
namespace {

constexpr unsigned READERS_PROCESSOR = 0, WRITERS_PROCESSOR = 1;
constexpr uint8_t FIRST_NODE = 16;
constexpr unsigned MANY_READERS = 8; /* more than processors */
constexpr size_t SINGLE_READINGS = 8192;

class Ours {
 public:
  using Visit = NoVisit;
  Ours(Cluster &cluster, uint8_t number)
      : node_(cluster, number, 1),
        instance_(node_.instance()),
        read_(cluster.getNodeLocators),
        refresh_(cluster.inModule<decltype(KARSTResolverRefreshNodeLocation)>(
            "KARSTResolverRefreshNodeLocation")) {}
  void read(Locators &into) { read_(instance_, &into); }
  void write(const Locators &) { refresh_(instance_, instance_->node); }
  zel_SpinlockHandle lock() const { return instance_->lock.handle; }

 private:
  const WatchedNode node_;
  KARSTResolverInstance *const instance_; /* at hand, as a client has it */
  decltype(KARSTResolver_GetNodeLocators) *const read_;
  decltype(KARSTResolverRefreshNodeLocation) *const refresh_;
};

/* ---- The writer ------------------------------------------------------------------------------ */

struct Pace {
  const char *name;
  std::optional<std::chrono::microseconds> period; /* none: nobody writes */
};
const Pace ALONE{"alone", {}}, TEN_KILOHERTZ{"writer at 10 kHz", std::chrono::microseconds(100)},
    FLAT_OUT{"writer flat out", std::chrono::microseconds(0)};

/* Writes at its pace, on a processor of its own, as long as it lives. */
template <typename Kept>
class Writer {
 public:
  Writer(Kept &kept, const Pace &pace) {
    if (!pace.period) return;
    thread_ = std::jthread([this, &kept, period = *pace.period](const std::stop_token &stop) {
      pin(WRITERS_PROCESSOR);
      write(kept, period, stop);
    });
    writing_.wait(false);
  }

 private:
  void write(Kept &kept, Clock::duration period, const std::stop_token &stop) {
    const Locators locators{};
    for (Clock::time_point due = Clock::now(); !stop.stop_requested();) {
      if (period != Clock::duration::zero() && Clock::now() < due) {
        _mm_pause();
        continue;
      }
      kept.write(locators);
      due += period;
      if (writing_.exchange(true, std::memory_order_relaxed)) continue;
      writing_.notify_one();
    }
  }

  std::atomic<bool> writing_{false};
  std::jthread thread_;
};

/* ---- Readings -------------------------------------------------------------------------------- */

/* One after the other, as fast as they go. */
template <typename Kept>
void readMany(benchmark::State &state, Kept &kept) {
  [[maybe_unused]] const typename Kept::Visit visit;
  alignas(64) Locators read{};
  read.capacity = KARST_RESOLVER_MAX_LOCATORS;
  for (auto _ : state) {
    kept.read(read);
    benchmark::DoNotOptimize(read);
  }
}

/* The timer counter, when all before it is done and nothing after it has begun. */
uint64_t cyclesNow() {
  _mm_lfence();
  const uint64_t now = __rdtsc();
  _mm_lfence();
  return now;
}

double nanosecondsPerCycle() {
  const auto start = Clock::now();
  const uint64_t first = __rdtsc();
  while (Clock::now() - start < std::chrono::milliseconds(20)) {
  }
  const uint64_t cycles = __rdtsc() - first;
  return std::chrono::duration<double, std::nano>(Clock::now() - start).count() /
         static_cast<double>(cycles);
}

/* What two looks at the timer counter take with nothing between them; the usual case of many. */
uint64_t timerCycles() {
  std::vector<uint64_t> taken(1001);
  for (uint64_t &cycles : taken) {
    const uint64_t start = cyclesNow();
    cycles = cyclesNow() - start;
  }
  std::nth_element(taken.begin(), taken.begin() + 500, taken.end());
  return taken[500];
}

/* A client does something else meanwhile: long enough for a writer that is at it to come to the lock,
 * and of varying length, so as not to fall into step with it. */
void pause() {
  const uint64_t start = __rdtsc();
  for (const uint64_t cycles = 2048 + start % 1024; __rdtsc() - start < cycles;) _mm_pause();
}

/* Each by itself, timed alone; what the timer takes is not counted. */
template <typename Kept>
void readOne(benchmark::State &state, Kept &kept) {
  static const double scale = nanosecondsPerCycle();
  static const uint64_t timer = timerCycles();
  bench::state("two looks at the timer counter, not counted", static_cast<double>(timer) * scale,
               "ns");
  [[maybe_unused]] const typename Kept::Visit visit;
  alignas(64) Locators read{};
  read.capacity = KARST_RESOLVER_MAX_LOCATORS;
  std::vector<double> times;
  times.reserve(SINGLE_READINGS);
  for (auto _ : state) {
    pause();
    const uint64_t start = cyclesNow();
    kept.read(read);
    const uint64_t end = cyclesNow();
    benchmark::DoNotOptimize(read);
    const double time = static_cast<double>(std::max(end - start, timer) - timer) * scale;
    times.push_back(time);
    state.SetIterationTime(time / 1e9);
  }
  percentiles(state, times);
}

/* ---- Each way of keeping them ---------------------------------------------------------------- */

const std::string SHARED_MUTEX = "std::shared_mutex", URCU_MEMB = "urcu-memb";
const std::string READ = "GetNodeLocators, ", ONE = "one GetNodeLocators, ";

template <typename Kept>
using Make = std::function<std::unique_ptr<Kept>()>;

template <typename Kept>
void measureKept(const std::string &who, const Make<Kept> &make) {
  const std::shared_ptr<Kept> kept = make();
  for (const Pace &pace : {ALONE, TEN_KILOHERTZ, FLAT_OUT}) {
    measure({READ + pace.name, who}, [=](auto &state) {
      const Writer writer(*kept, pace);
      readMany(state, *kept);
    });
    measure({ONE + pace.name, who},
            [=](auto &state) {
              const Writer writer(*kept, pace);
              readOne(state, *kept);
            })
        ->UseManualTime()
        ->Iterations(SINGLE_READINGS);
  }
}

/* So many readers at once; the time is that of one reading of all of them together. */
template <typename Kept>
void measureReaders(const std::string &who, const Make<Kept> &make) {
  for (const unsigned readers : {2u, MANY_READERS}) {
    std::vector<std::shared_ptr<Kept>> kept;
    for (unsigned i = 0; i < readers; i++) kept.push_back(make());
    for (const bool same : {true, false}) {
      const std::string work =
          READ + std::to_string(readers) + (same ? " readers of one" : " readers, one each");
      measure({work, who},
              [=](auto &state) {
                const auto thread = static_cast<unsigned>(state.thread_index());
                pin(thread);
                readMany(state, *kept[same ? 0 : thread]);
              })
          ->Threads(static_cast<int>(readers))
          ->UseRealTime();
    }
  }
}

template <typename Kept>
void measurePeer(const std::string &who) {
  const Make<Kept> make = [] { return std::make_unique<Kept>(); };
  measureKept<Kept>(who, make);
  measureReaders<Kept>(who, make);
}

/* What programs do today: they ask for the addresses of a name, one that the hosts file has. */
void lookUpName(benchmark::State &state) {
  addrinfo hints{};
  hints.ai_flags = AI_NUMERICSERV;
  hints.ai_family = AF_INET;
  hints.ai_socktype = SOCK_STREAM;
  for (auto _ : state) {
    addrinfo *found = nullptr;
    if (getaddrinfo("localhost", "80", &hints, &found) != 0) {
      return state.SkipWithError("localhost is not known");
    }
    freeaddrinfo(found);
  }
}

/* ---- The least, and the lock ----------------------------------------------------------------- */

const std::string COPY = limit("copy"), LOCKED_COPY = limit("copy, exchange, store"),
                  CALLED_COPY = limit("copy, exchange, store, called");

void exchange(benchmark::State &state) {
  std::atomic<uint32_t> word{0};
  for (auto _ : state) benchmark::DoNotOptimize(word.exchange(1, std::memory_order_acquire));
}

/* A module's function is called, and it calls the platform's two. */
class BehindCalls {
 public:
  using Visit = NoVisit;
  __attribute__((noinline)) void read(Locators &into) { kept_.read(into); }
  void write(const Locators &from) { kept_.write(from); }

 private:
  Behind<OneExchangeCalled> kept_;
};

template <typename Kept>
void measureLimit(const std::string &who) {
  const auto kept = std::make_shared<Kept>();
  measure({READ + ALONE.name, who}, [=](auto &state) { readMany(state, *kept); });
  measure({ONE + ALONE.name, who}, [=](auto &state) { readOne(state, *kept); })
      ->UseManualTime()
      ->Iterations(SINGLE_READINGS);
}

template <typename Kept>
void measureLimit(const std::string &who, const Pace &pace) {
  const auto kept = std::make_shared<Kept>();
  measure({READ + pace.name, who}, [=](auto &state) {
    const Writer writer(*kept, pace);
    readMany(state, *kept);
  });
}

void measureLock(const std::shared_ptr<Ours> &ours) {
  const std::string work = "spinlock: lock, unlock", bare = limit("one exchange, one store");
  measure({work}, [=](auto &state) {
    const zel_SpinlockHandle lock = ours->lock();
    for (auto _ : state) {
      zel_SpinlockLock(lock);
      zel_SpinlockUnlock(lock);
    }
  });
  measure({work, bare}, [](auto &state) {
    OneExchangeCalled lock; /* called as the host's are, without what those check and note */
    for (auto _ : state) {
      lock.lock();
      lock.unlock();
    }
  });
  ask(work, 1.5, {bare});
}

}  // namespace

void measureReadOut(Cluster &cluster) {
  const Make<Ours> make = [&cluster, number = FIRST_NODE]() mutable {
    return std::make_unique<Ours>(cluster, number++);
  };
  measureKept<Ours>(OURS, make);
  measureReaders<Ours>(OURS, make);
  measurePeer<BehindSharedMutex>(SHARED_MUTEX);
  measurePeer<BehindMutex>("std::mutex");
  measurePeer<BehindSpinlock>("pthread_spinlock_t");
  measurePeer<Published<Memb>>(URCU_MEMB);
  measurePeer<Published<Qsbr>>("urcu-qsbr");
  measurePeer<BySharedPtr>("std::atomic<std::shared_ptr>");
  measure({READ + ALONE.name, "getaddrinfo, hosts file"}, lookUpName);
  measureLimit<Behind<NoLock>>(COPY);
  measure({READ + ALONE.name, limit("one exchange")}, exchange);
  measureLimit<Behind<OneExchange>>(LOCKED_COPY);
  measureLimit<BehindCalls>(CALLED_COPY);
  measureLimit<BehindCalls>(CALLED_COPY, TEN_KILOHERTZ);
  measureLock(make());

  for (const Pace &pace : {ALONE, TEN_KILOHERTZ}) {
    const std::string work = READ + pace.name;
    ask({work, {work}, 1.5, {{READ + ALONE.name, LOCKED_COPY}}});
    nameFloor(work, CALLED_COPY);
    ask(work, 0.6, {SHARED_MUTEX});
    ask(work, 1.0, {URCU_MEMB});
  }
  const std::string one = ONE + FLAT_OUT.name;
  ask({one + ": p99 of p50", {one + ", p99"}, 3, {{one + ", p50"}}});
}

}  // namespace bench
