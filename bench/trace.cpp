/* A trace statement whose class is off and on, as the module's macro writes it and with the module's
 * emitter, beside the least that could be done in its place; and SetCallback in the loaded module,
 * which has one such statement on its way. */
#include <atomic>
#include <memory>

#include "bench/subjects.h"
#include "karst_resolver/trace.h"

namespace bench {
namespace {

constexpr uint32_t CLASS = KARST_RESOLVER_TRACE_CLASS_SetCallback;
constexpr int32_t LEVEL = KARST_RESOLVER_TRACE_LEVEL_SetCallback;

/* Selects the events of the class for as long as it lives. */
class ClassOn {
 public:
  ClassOn() { host::setTraceClassLevel(CLASS, LEVEL); }
  ~ClassOn() { host::setTraceClassLevel(CLASS, 0); }
  ClassOn(const ClassOn &) = delete;
  ClassOn &operator=(const ClassOn &) = delete;
};

struct Site {
  decltype(KARSTResolverTraceEmit) *emit;
  TokenBucketMini *bucket;
};

void trace(benchmark::State &state, const Site &site) {
  uint64_t value = 0;
  for (auto _ : state) {
    if (Trace_ClassLevelGet(CLASS) >= LEVEL) {
      const uint64_t payload[6] = {++value, value, value};
      site.emit(site.bucket, KARST_RESOLVER_TRACE_ID_SetCallback, 1, payload);
    }
  }
}

__attribute__((noinline)) void emptyCall() {
  asm volatile("");
}

/* A ring as large as the trace stream's. */
struct Ring {
  struct alignas(64) Record {
    uint64_t words[8];
  };
  std::atomic<uint64_t> sequence{0};
  std::vector<Record> records = std::vector<Record>(host::TraceSettings{}.slots);

  void write(uint64_t time, uint64_t value) {
    const uint64_t number = sequence.fetch_add(1, std::memory_order_relaxed);
    records[number & (records.size() - 1)] = {{time, number, value, value, value, 0, 0, 0}};
    benchmark::ClobberMemory();
  }
};

}  // namespace

void measureTrace(Cluster &cluster) {
  const Site site = {cluster.inModule<decltype(KARSTResolverTraceEmit)>("KARSTResolverTraceEmit"),
                     cluster.inModule<TokenBucketMini>("KARSTResolverTraceSetCallbackTb")};

  const std::string off = "trace: statement, class off";
  measure({off}, [=](auto &state) { trace(state, site); });
  measure({off, "empty call"}, [](auto &state) {
    for (auto _ : state) emptyCall();
  });

  const std::string written = "trace: statement, written";
  const auto ring = std::make_shared<Ring>();
  measure({written}, [=](auto &state) {
    const ClassOn on;
    trace(state, site);
  });
  measure({written, "fetch_add, 64-byte store"}, [=](auto &state) {
    for (auto _ : state) ring->write(1, 2);
  });
  measure({written, "clock, fetch_add, 64-byte store"}, [=](auto &state) {
    for (auto _ : state) {
      ring->write(static_cast<uint64_t>(Clock::now().time_since_epoch().count()), 2);
    }
  });

  const auto node = std::make_shared<WatchedNode>(cluster, 1, 1);
  const auto setCallback = [&cluster, node](auto &state) {
    for (auto _ : state) cluster.setCallback(node->instance(), nullptr, nullptr);
  };
  measure({"SetCallback(null), trace written"}, [=](auto &state) {
    const ClassOn on;
    setCallback(state);
  });
  measure({"SetCallback(null), trace written", "the same, class off"}, setCallback);
}

}  // namespace bench
