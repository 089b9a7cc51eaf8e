/* From a change in the directory to the client's callback, and what one of many instances costs,
 * beside bare threads with as many hand-offs: the directory's delivery thread gets the change and
 * hands it to the resolver's own thread, which calls. */
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>

#include "bench/subjects.h"

namespace bench {
namespace {

constexpr uint8_t LATENCY_NODE = 3;

/* A thread that waits for what it is handed, and does it. */
class Stage {
 public:
  explicit Stage(std::function<void()> work) : work_(std::move(work)) {}
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

  void put() {
    {
      const std::lock_guard lock(mutex_);
      due_++;
    }
    filled_.notify_one();
  }
  /* Returns when all is done and the thread waits again. */
  void settle() {
    std::unique_lock lock(mutex_);
    idle_.wait(lock, [this] { return waiting_ && due_ == 0; });
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      waiting_ = true;
      idle_.notify_one();
      filled_.wait(lock, [this] { return due_ != 0 || ending_; });
      if (due_ == 0) return;
      waiting_ = false;
      due_--;
      lock.unlock();
      work_();
      lock.lock();
    }
  }

  const std::function<void()> work_;
  std::mutex mutex_;
  std::condition_variable filled_, idle_;
  size_t due_ = 0;
  bool waiting_ = false, ending_ = false;
  std::thread thread_{[this] { run(); }};
};

/* As many hand-offs as a change takes. */
struct HandOffs {
  explicit HandOffs(std::function<void()> work) : second(std::move(work)) { settle(); }
  void put() { first.put(); }
  void settle() {
    first.settle();
    second.settle();
  }

  Stage second;
  Stage first{[this] { second.put(); }};
};

double seconds(Clock::time_point from, Clock::time_point to) {
  return std::chrono::duration<double>(to - from).count();
}

/* Tells the directory of one change of the node. False when not each instance was called once. */
bool change(Cluster &cluster, WatchedNode &node, Clock::time_point *start) {
  host::Entry entry = node.nextChange();
  const uint64_t before = node.calls();
  *start = Clock::now();
  cluster.kernel.directory().put(std::move(entry));
  cluster.kernel.settle();
  return node.calls() == before + node.instances();
}

void latency(benchmark::State &state, Cluster &cluster, WatchedNode &node) {
  for (auto _ : state) {
    Clock::time_point start;
    if (!change(cluster, node, &start)) return state.SkipWithError("not one call for one change");
    state.SetIterationTime(seconds(start, node.lastCall()));
  }
}

void bareLatency(benchmark::State &state) {
  Clock::time_point called;
  HandOffs handOffs([&] { called = Clock::now(); });
  for (auto _ : state) {
    const Clock::time_point start = Clock::now();
    handOffs.put();
    handOffs.settle();
    state.SetIterationTime(seconds(start, called));
  }
}

void refresh(benchmark::State &state, Cluster &cluster, WatchedNode &node) {
  state.counters[ITEMS] = static_cast<double>(node.instances());
  for (auto _ : state) {
    Clock::time_point start;
    if (!change(cluster, node, &start)) return state.SkipWithError("not each called once");
    state.SetIterationTime(seconds(start, Clock::now()));
  }
}

/* One lock, a list of functions, and each observer keeps a copy of what it was told. */
void bareRefresh(benchmark::State &state, size_t observers) {
  struct Observer {
    KARSTResolverNodeLocators kept;
    uint64_t calls;
  };
  std::vector<Observer> kept(observers);
  std::vector<std::function<void(const KARSTResolverNodeLocators &)>> functions;
  for (Observer &observer : kept) {
    functions.emplace_back([&observer](const KARSTResolverNodeLocators &locators) {
      observer.kept = locators;
      observer.calls++;
    });
  }
  std::mutex mutex;
  HandOffs handOffs([&] {
    const std::lock_guard lock(mutex);
    const KARSTResolverNodeLocators locators{};
    for (const auto &function : functions) function(locators);
  });
  state.counters[ITEMS] = static_cast<double>(observers);
  for (auto _ : state) {
    const Clock::time_point start = Clock::now();
    handOffs.put();
    handOffs.settle();
    state.SetIterationTime(seconds(start, Clock::now()));
  }
  benchmark::DoNotOptimize(kept.data());
}

}  // namespace

void measureChange(Cluster &cluster) {
  const auto node = std::make_shared<WatchedNode>(cluster, LATENCY_NODE, 1);
  measure({"change to callback"}, [&cluster, node](auto &state) {
    latency(state, cluster, *node);
  })->UseManualTime();
  measure({"change to callback", "two bare hand-offs"}, bareLatency)->UseManualTime();

  uint8_t number = LATENCY_NODE;
  for (const size_t instances : {128, 10'000}) {
    const auto many = std::make_shared<WatchedNode>(cluster, ++number, instances);
    const std::string work = "refresh an instance of " + std::to_string(instances);
    measure({work}, [&cluster, many](auto &state) {
      refresh(state, cluster, *many);
    })->UseManualTime();
    measure({work, "functions called under a mutex"}, [=](auto &state) {
      bareRefresh(state, instances);
    })->UseManualTime();
  }
}

}  // namespace bench
