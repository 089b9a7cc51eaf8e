/* From a change in the directory to the client's callback, on an idle system and while other changes
 * come, beside bare threads with as many hand-offs: the directory's delivery thread gets the change
 * and hands it to the resolver's own thread, which calls. And how little a burst costs. */
#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <semaphore>
#include <thread>

#include "bench/subjects.h"
#include "host/directory/records.h"

namespace bench {
namespace {

enum : uint8_t { LATENCY_NODE = 3, STREAM_NODE = 4, BURST_NODE = 5, HOLDING_NODE = 6 };

constexpr std::chrono::microseconds STREAM_INTERVAL{50}; /* and the system's slack */
constexpr size_t BURST = 64;

/* ---- Bare hand-offs -------------------------------------------------------------------------- */

/* A thread that waits for what it is handed, and does it. */
class Stage {
 public:
  explicit Stage(std::function<void(bool)> work) : work_(std::move(work)) {}
  ~Stage() {
    {
      const std::lock_guard lock(mutex_);
      ending_ = true;
    }
    filled_.notify_one();
    thread_.join();
  }
  Stage(const Stage &) = delete;
  Stage &operator=(const Stage &) = delete;

  void put(bool measured) {
    {
      const std::lock_guard lock(mutex_);
      due_.push_back(measured);
    }
    filled_.notify_one();
  }
  /* Returns when all is done and the thread waits again. */
  void settle() {
    std::unique_lock lock(mutex_);
    idle_.wait(lock, [this] { return waiting_ && due_.empty(); });
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      waiting_ = true;
      idle_.notify_one();
      filled_.wait(lock, [this] { return !due_.empty() || ending_; });
      if (due_.empty()) return;
      waiting_ = false;
      const bool measured = due_.front();
      due_.pop_front();
      lock.unlock();
      work_(measured);
      lock.lock();
    }
  }

  const std::function<void(bool)> work_;
  std::mutex mutex_;
  std::condition_variable filled_, idle_;
  std::deque<bool> due_; /* is this the one that is measured? */
  bool waiting_ = false, ending_ = false;
  std::thread thread_{[this] { run(); }};
};

/* As many hand-offs as a change takes, with nothing to do before the first but `before`, and before the
 * second but `between`. */
class HandOffs {
 public:
  explicit HandOffs(
      std::function<void()> before = [] {}, std::function<void()> between = [] {})
      : before_(std::move(before)), between_(std::move(between)) {
    settle();
  }
  void put(bool measured) {
    before_();
    first_.put(measured);
  }
  void settle() {
    first_.settle();
    second_.settle();
  }
  Clock::time_point lastCall() const { return called_; }

 private:
  const std::function<void()> before_, between_;
  std::atomic<Clock::time_point> called_{};
  Stage second_{[this](bool measured) {
    if (measured) called_ = Clock::now();
  }};
  Stage first_{[this](bool measured) {
    between_();
    second_.put(measured);
  }};
};

/* ---- A stream of other changes --------------------------------------------------------------- */

class Stream {
 public:
  explicit Stream(std::function<void()> change) : change_(std::move(change)) {}
  ~Stream() {
    ending_ = true;
    thread_.join();
  }
  Stream(const Stream &) = delete;
  Stream &operator=(const Stream &) = delete;

 private:
  void run() {
    while (!ending_) {
      change_();
      std::this_thread::sleep_for(STREAM_INTERVAL);
    }
  }

  const std::function<void()> change_;
  std::atomic<bool> ending_{false};
  std::thread thread_{[this] { run(); }};
};

/* ---- Change to callback ---------------------------------------------------------------------- */

double nanoseconds(Clock::duration duration) {
  return std::chrono::duration<double, std::nano>(duration).count();
}

/* `once` makes one change, lets all settle, and returns how long it took to the call. */
template <typename Once>
void latencies(benchmark::State &state, Once once) {
  std::vector<double> times;
  for (auto _ : state) {
    times.push_back(nanoseconds(once()));
    state.SetIterationTime(times.back() * 1e-9);
  }
  percentiles(state, times);
}

void latency(benchmark::State &state, WatchedNode &node) {
  bool once = true;
  latencies(state, [&] {
    Clock::time_point start;
    once &= node.change(&start);
    return node.lastCall() - start;
  });
  if (!once) state.SkipWithError("not one call for one change");
}

void bareLatency(benchmark::State &state, HandOffs &handOffs) {
  latencies(state, [&] {
    const Clock::time_point start = Clock::now();
    handOffs.put(true);
    handOffs.settle();
    return handOffs.lastCall() - start;
  });
}

/* ---- The least: two wake-ups ----------------------------------------------------------------- */

class Futex {
 public:
  void post() {
    word_.store(1, std::memory_order_release);
    syscall(SYS_futex, &word_, FUTEX_WAKE_PRIVATE, 1);
  }
  void wait() {
    while (word_.load(std::memory_order_acquire) == 0) {
      syscall(SYS_futex, &word_, FUTEX_WAIT_PRIVATE, 0, nullptr);
    }
    word_.store(0, std::memory_order_relaxed);
  }

 private:
  std::atomic<uint32_t> word_{0};
};

/* There and back again: one system call that wakes, each way. */
void futexRoundTrip(benchmark::State &state, unsigned processor) {
  Futex there, back;
  std::atomic<bool> ending{false};
  std::thread other([&] {
    for (there.wait(); !ending; there.wait()) back.post();
  });
  const OthersPinned pinned(processor);
  latencies(state, [&] {
    const Clock::time_point start = Clock::now();
    there.post();
    back.wait();
    return Clock::now() - start;
  });
  ending = true;
  there.post();
  other.join();
}

/* ---- A burst --------------------------------------------------------------------------------- */

/* Keeps the resolver's world inside a client's callback from its construction to release(). */
class HeldWorld {
 public:
  HeldWorld(Cluster &cluster, WatchedNode &node) : cluster_(cluster), node_(node) {
    cluster.setCallback(node.instance(), hold, this); /* which calls, on this thread */
    armed_ = true;
    cluster.kernel.directory().put(node.nextChange());
    held_.acquire();
  }
  ~HeldWorld() { cluster_.setCallback(node_.instance(), nullptr, nullptr); }
  HeldWorld(const HeldWorld &) = delete;
  HeldWorld &operator=(const HeldWorld &) = delete;
  void release() {
    release_.release();
    cluster_.kernel.settle();
  }

 private:
  static void hold(void *data, KARSTResolverInstance *, uint32_t) {
    auto *self = static_cast<HeldWorld *>(data);
    if (!self->armed_.exchange(false)) return;
    self->held_.release();
    self->release_.acquire();
  }

  Cluster &cluster_;
  WatchedNode &node_;
  std::atomic<bool> armed_{false};
  std::binary_semaphore held_{0}, release_{0};
};

/* The world does not run while the changes come. A wait that it enters and one that it leaves are
 * both counted, and the last one is not left. */
void burst(benchmark::State &state, Cluster &cluster, WatchedNode &node, WatchedNode &holding) {
  for (auto _ : state) {
    HeldWorld held(cluster, holding);
    const uint64_t activity = host::worldsActivity(), calls = node.calls();
    for (size_t i = 0; i < BURST; i++) cluster.kernel.directory().put(node.nextChange());
    cluster.kernel.directory().waitUntilIdle();
    const Clock::time_point start = Clock::now();
    held.release();
    state.SetIterationTime(nanoseconds(Clock::now() - start) * 1e-9);
    askCount("wakes of the world for a burst of 64 changes of one node",
             (host::worldsActivity() - activity) / 2, 1);
    askCount("refreshes of an instance for that burst", node.calls() - calls, 1);
  }
}

/* What no change can leave out: the entry is written by who changes it, perhaps on another processor,
 * and read and decoded by who is told. */
class WrittenEntry {
 public:
  void write() {
    const std::lock_guard lock(mutex_);
    written_ = entry_.data;
  }
  void read() {
    std::vector<uint8_t> data;
    {
      const std::lock_guard lock(mutex_);
      data = written_;
    }
    KarstNetInterfaceEntry record;
    if (host::decode(data, &record) != ZEL_OK) std::abort();
    benchmark::DoNotOptimize(record);
  }

 private:
  const host::Entry entry_ = interfaceEntry(LATENCY_NODE, 0, 4);
  std::mutex mutex_;
  std::vector<uint8_t> written_;
};

/* The same hand-offs with that. */
struct LeastChange {
  WrittenEntry entry;
  HandOffs handOffs{[this] { entry.write(); }, [this] { entry.read(); }};
};

/* The client is on processor 0, what serves it on one or the other, a stream on the client's. */
void measureLatency(Cluster &cluster, const std::string &where, unsigned processor,
                    const std::shared_ptr<WatchedNode> &node,
                    const std::shared_ptr<WatchedNode> &other) {
  const std::string peer = "two bare hand-offs", least = limit("two hand-offs, entry");

  const std::string idle = "change to callback, " + where;
  measure({idle}, [=](auto &state) {
    const OthersPinned pinned(processor);
    latency(state, *node);
  })->UseManualTime();
  measure({idle, peer}, [=](auto &state) {
    HandOffs handOffs;
    const OthersPinned pinned(processor);
    bareLatency(state, handOffs);
  })->UseManualTime();
  measure({idle, least}, [=](auto &state) {
    LeastChange change;
    const OthersPinned pinned(processor);
    bareLatency(state, change.handOffs);
  })->UseManualTime();
  measure({idle, limit("a futex there and back")}, [=](auto &state) {
    futexRoundTrip(state, processor);
  })->UseManualTime();

  const std::string streaming = "in a stream, " + where;
  measure({streaming}, [=, &cluster](auto &state) {
    const OthersPinned pinned(processor);
    const Stream stream([&] { cluster.kernel.directory().put(other->nextChange()); });
    latency(state, *node);
  })->UseManualTime();
  measure({streaming, peer}, [=](auto &state) {
    HandOffs handOffs;
    const OthersPinned pinned(processor);
    const Stream stream([&] { handOffs.put(false); });
    bareLatency(state, handOffs);
  })->UseManualTime();
  measure({streaming, least}, [=](auto &state) {
    LeastChange change;
    const OthersPinned pinned(processor);
    const Stream stream([&] { change.handOffs.put(false); });
    bareLatency(state, change.handOffs);
  })->UseManualTime();

  for (const std::string &work : {idle, streaming}) {
    ask(work + ", p50", 1.2, {peer});
    ask(work + ", p99", 1.5, {peer});
    for (const char *percentile : {", p50", ", p99"}) nameFloor(work + percentile, least);
  }
}

}  // namespace

void measureChange(Cluster &cluster) {
  const auto node = std::make_shared<WatchedNode>(cluster, LATENCY_NODE, 1);
  const auto other = std::make_shared<WatchedNode>(cluster, STREAM_NODE, 1);
  measureLatency(cluster, "one processor", 0, node, other);
  measureLatency(cluster, "two processors", 1, node, other);
  const auto many = std::make_shared<WatchedNode>(cluster, BURST_NODE, 1);
  const auto holding = std::make_shared<WatchedNode>(cluster, HOLDING_NODE, 1);
  measure({"last of a burst of 64 changes"}, [&cluster, many, holding](auto &state) {
    burst(state, cluster, *many, *holding);
  })->UseManualTime();
}

}  // namespace bench
