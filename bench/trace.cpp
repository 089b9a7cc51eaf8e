/* A trace statement in each of its states (class off, stream off, written, throttled, two threads at
 * once) beside tracers in use, a logger, and the least that the machine allows; and SetCallback in
 * the loaded module, which has one such statement on its way. */
#include <dlfcn.h>
#include <spdlog/async.h>
#include <spdlog/sinks/null_sink.h>
#include <x86intrin.h>

#include <atomic>
#include <memory>
#include <stdexcept>
#include <thread>

#include "bench/lttng/session.h"
#include "bench/subjects.h"
#include "bench/trace_sites.h"
#include "host/threads/clock.h"
#include "karst_resolver/trace.h"

namespace bench {
namespace {

constexpr uint32_t CLASS = KARST_RESOLVER_TRACE_CLASS_SetCallback;
constexpr int32_t LEVEL = KARST_RESOLVER_TRACE_LEVEL_SetCallback;

constexpr int EVENTS = 10; /* of one call of what is measured here */

const std::string LTTNG = "LTTng-UST, as it is";
const std::string LTTNG_MATCHED = "LTTng-UST, our clock";
const std::string LTTNG_OFF = "LTTng-UST, tracepoint off";
const std::string SPDLOG = "spdlog, async, null sink";
const std::string LEAST = limit("fetch_add, clock, 64-byte store");
const std::string LEAST_REFUSAL = limit("three calls, the tick's clock");
const std::string EMPTY_CALL = limit("empty call");
const std::string NOTHING = limit("the loop alone");

const std::string OFF = "trace: class off";
const std::string STREAM_OFF = "trace: stream off";
const std::string WRITTEN = "trace: written";
const std::string THROTTLED = "trace: throttled";
const std::string TOGETHER = "trace: written by two threads";

/* ---- States, for as long as they live -------------------------------------------------------- */

struct ClassOn {
  ClassOn() { host::setTraceClassLevel(CLASS, LEVEL); }
  ~ClassOn() { host::setTraceClassLevel(CLASS, 0); }
  ClassOn(const ClassOn &) = delete;
  ClassOn &operator=(const ClassOn &) = delete;
};

struct StreamOff : ClassOn {
  StreamOff() { host::setTraceEnabled(false); }
  ~StreamOff() { host::setTraceEnabled(true); }
};

struct Throttling : ClassOn {
  Throttling() { host::setTraceThrottling(true); }
  ~Throttling() { host::setTraceThrottling(false); }
};

/* ---- What is measured: functions that emit ten events ---------------------------------------- */

template <typename Function>
Function *siteFunction(const char *name) {
  static void *const library = dlopen(TRACE_SITES_SO, RTLD_NOW);
  void *const function = library == nullptr ? nullptr : dlsym(library, name);
  if (function == nullptr) throw std::runtime_error(dlerror());
  return reinterpret_cast<Function *>(function);
}

/* A ring as large as the trace stream's, and no more than a record needs: a number of its own, the
 * processor's counter, scaled as if to nanoseconds, one line of the cache. All of it inline. */
class LeastRing {
 public:
  void tenRecords(uint64_t value) {
    for (int i = 0; i < EVENTS; i++) {
      const uint64_t number = sequence_.fetch_add(1, std::memory_order_relaxed);
      const uint64_t time = nanoseconds(__rdtsc());
      records_[number % records_.size()] = {{time, number, value, value, value, 0, 0, 0}};
      benchmark::ClobberMemory();
    }
  }

 private:
  static uint64_t nanoseconds(uint64_t cycles) {
    constexpr uint64_t SCALE = 0x60000000; /* what it says is not looked at, what it takes is */
    return static_cast<uint64_t>(static_cast<unsigned __int128>(cycles) * SCALE >> 32);
  }
  struct alignas(64) Record {
    uint64_t words[8];
  };
  std::atomic<uint64_t> sequence_{0};
  std::vector<Record> records_ = std::vector<Record>(host::TraceSettings{}.slots);
};

/* An event that comes to nothing: its class is on, its payload laid down, its bucket dry by the clock of
 * the last tick. A platform is asked by calls, and payloads are handed over by one. */
class LeastRefusal {
 public:
  void tenRefused(uint64_t value) {
    for (int i = 0; i < EVENTS; i++) {
      if (!isOn()) continue;
      const uint64_t payload[6] = {value, value, value};
      emit(payload);
    }
  }

 private:
  __attribute__((noinline)) bool isOn() const { return on_.load(std::memory_order_relaxed); }
  __attribute__((noinline)) bool take() const {
    return host::tickNanoseconds() >= due_.load(std::memory_order_relaxed);
  }
  __attribute__((noinline)) void emit(const uint64_t payload[6]) {
    if (on_.load(std::memory_order_relaxed) && take()) written_ += payload[0];
  }
  std::atomic<bool> on_{true};
  std::atomic<uint64_t> due_{UINT64_MAX};
  uint64_t written_ = 0;
};

/* The text is made where it is logged; a thread on any processor takes it from a queue, of which the
 * oldest entries give way, as in our ring. */
class Logger {
 public:
  Logger() {
    unpin();
    pool_ = std::make_shared<spdlog::details::thread_pool>(8192, 1);
    pin(0);
    logger_ = std::make_shared<spdlog::async_logger>(
        "bench", std::make_shared<spdlog::sinks::null_sink_mt>(), pool_,
        spdlog::async_overflow_policy::overrun_oldest);
  }
  void tenLines(uint64_t value) {
    for (int i = 0; i < EVENTS; i++) {
      logger_->info("{} {} {} {} {} {}", value, value, value, 0u, 0u, 0u);
    }
  }

 private:
  std::shared_ptr<spdlog::details::thread_pool> pool_;
  std::shared_ptr<spdlog::async_logger> logger_;
};

/* ---- How it is measured ---------------------------------------------------------------------- */

template <typename Emit>
void run(benchmark::State &state, const Emit &emitTen) {
  uint64_t value = 0;
  for (auto _ : state) emitTen(++value);
  state.counters[ITEMS] = EVENTS;
}

/* Emits on another processor for as long as it lives. */
template <typename Emit>
class Beside {
 public:
  explicit Beside(const Emit &emitTen)
      : thread_([emitTen](const std::stop_token &stop) {
          pin(1);
          for (uint64_t value = 0; !stop.stop_requested(); value++) emitTen(value);
        }) {}

 private:
  std::jthread thread_;
};

/* Written by one thread; and what a record takes one of two that write all the time. */
template <typename State, typename Emit>
void measureWritten(const std::string &who, const Emit &emitTen) {
  measure({WRITTEN, who}, [=](auto &state) {
    [[maybe_unused]] const State on;
    run(state, emitTen);
  });
  measure({TOGETHER, who}, [=](auto &state) {
    [[maybe_unused]] const State on;
    const Beside other(emitTen);
    run(state, emitTen);
  });
}

struct NoState {
  NoState() {}
};

/* ---- The subjects ---------------------------------------------------------------------------- */

void measureOurs() {
  auto *const sites = siteFunction<decltype(benchTraceSites)>("benchTraceSites");
  measure({OFF}, [=](auto &state) { run(state, sites); });
  measure({STREAM_OFF}, [=](auto &state) {
    const StreamOff off;
    run(state, sites);
  });
  measure({THROTTLED}, [=](auto &state) {
    const Throttling throttling;
    run(state, sites);
  });
  measureWritten<ClassOn>(OURS, sites);
}

void measureLimits() {
  for (const auto &[who, name] :
       {std::pair(EMPTY_CALL, "benchEmptyCalls"), std::pair(NOTHING, "benchNothing")}) {
    auto *const function = siteFunction<decltype(benchEmptyCalls)>(name);
    measure({OFF, who}, [=](auto &state) { run(state, function); });
  }
  const auto refusal = std::make_shared<LeastRefusal>();
  measure({THROTTLED, LEAST_REFUSAL},
          [=](auto &state) { run(state, [&](uint64_t value) { refusal->tenRefused(value); }); });
  const auto ring = std::make_shared<LeastRing>();
  measureWritten<NoState>(LEAST, [ring](uint64_t value) { ring->tenRecords(value); });
}

void measureLogger() {
  const auto logger = std::make_shared<Logger>();
  measureWritten<NoState>(SPDLOG, [logger](uint64_t value) { logger->tenLines(value); });
}

std::shared_ptr<const LttngSession> session() {
  unpin(); /* the tracer's own threads run on all processors */
  const auto session = std::make_shared<const LttngSession>();
  pin(0);
  return session;
}

void measureLttng() {
  try {
    static const auto theSession = session();
    struct Matched {
      Matched() { theSession->clockMatched(true); }
      ~Matched() { theSession->clockMatched(false); }
    };
    measure({OFF, LTTNG_OFF}, [](auto &state) { run(state, theSession->tracepointsOff); });
    measureWritten<NoState>(LTTNG, theSession->tracepointsOn);
    measureWritten<Matched>(LTTNG_MATCHED, theSession->tracepointsOn);
  } catch (const std::runtime_error &error) {
    pin(0);
    notMeasured({OFF, LTTNG_OFF}, error.what());
    for (const std::string &work : {WRITTEN, TOGETHER}) {
      for (const std::string &who : {LTTNG, LTTNG_MATCHED}) notMeasured({work, who}, error.what());
    }
  }
}

void measureSetCallback(Cluster &cluster) {
  const std::string work = "SetCallback(null), trace written";
  const auto node = std::make_shared<WatchedNode>(cluster, 1, 1);
  const auto setCallback = [&cluster, node](auto &state) {
    for (auto _ : state) cluster.setCallback(node->instance(), nullptr, nullptr);
  };
  measure({work}, [=](auto &state) {
    const ClassOn on;
    setCallback(state);
  });
  measure({work, "the same, class off"}, setCallback);
}

}  // namespace

void measureTrace(Cluster &cluster) {
  measureOurs();
  measureLttng();
  measureLogger();
  measureLimits();
  measureSetCallback(cluster);

  const Bar off{OFF + ", over the loop alone", {OFF}, 0.15, {{OFF, EMPTY_CALL}}, {{OFF, NOTHING}}};
  ask(off);
  nameFloor(off);
  ask(WRITTEN, 0.08, {LTTNG});
  ask(WRITTEN, 0.3, {LTTNG_MATCHED});
  ask(WRITTEN, 1.2, {LEAST});
  nameFloor(WRITTEN, LEAST);
  ask({THROTTLED, {THROTTLED}, 0.3, {{WRITTEN}}});
  nameFloor(THROTTLED, LEAST_REFUSAL);
}

}  // namespace bench
