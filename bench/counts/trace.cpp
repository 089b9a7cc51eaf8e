/* A trace statement in each of its states, with the module's macro, emission and flags. */
#include <dlfcn.h>

#include <stdexcept>

#include "bench/cluster.h"
#include "bench/counts/counts.h"
#include "bench/trace_sites.h"
#include "karst_resolver/trace.h"

namespace bench {
namespace {

constexpr uint32_t CLASS = KARST_RESOLVER_TRACE_CLASS_SetCallback;
constexpr int32_t LEVEL = KARST_RESOLVER_TRACE_LEVEL_SetCallback;

/* As many as the stream has between two of its rarest duties; ten in each call. */
constexpr size_t EVENTS = 10 * TRACE_WALL_CLOCK_EVERY;

decltype(benchTraceSites) *traceSites() {
  void *const library = dlopen(TRACE_SITES_SO, RTLD_NOW);
  void *const function = library == nullptr ? nullptr : dlsym(library, "benchTraceSites");
  if (function == nullptr) throw std::runtime_error(dlerror());
  return reinterpret_cast<decltype(benchTraceSites) *>(function);
}

}  // namespace

void countTrace() {
  const Cluster cluster;
  auto *const tenEvents = traceSites();
  const auto emit = [&] {
    for (size_t value = 0; value < EVENTS / 10; value++) tenEvents(value);
  };
  count("trace: class off", EVENTS, emit);
  host::setTraceClassLevel(CLASS, LEVEL);
  count("trace: written", EVENTS, emit);
  host::setTraceEnabled(false);
  count("trace: stream off", EVENTS, emit);
  host::setTraceEnabled(true);
  host::setTraceThrottling(true);
  count("trace: throttled", EVENTS, emit);
  host::setTraceThrottling(false);
  host::setTraceClassLevel(CLASS, 0);
}

}  // namespace bench
