/* The platform's timer: the processor's time stamp counter, where the kernel itself keeps time by it,
 * and else the machine's monotonic clock. No lock.
 *
 * The kernel goes by the counter only when it runs at one rate and alike on all processors, so what
 * one thread reads never goes back. It is not read in order with the loads around it, which would
 * cost half as much again: of two threads, one may find itself some nanoseconds behind what the
 * other told it. Its nanoseconds start with the monotonic clock's, and part from them by some
 * millionths of the time since.
 */
#include "host/threads/clock.h"

#include <dlfcn.h>
#include <x86intrin.h>

#include <ctime>
#include <fstream>
#include <string>

#include "platform/zel.h"

namespace host {

constinit SystemClock systemClock = clock_gettime;

namespace {

constexpr uint64_t kSecond = 1'000'000'000;

SystemClock kernelsClock() {
  void *const vdso = dlopen("linux-vdso.so.1", RTLD_NOW | RTLD_NOLOAD);
  void *const clock = vdso == nullptr ? nullptr : dlsym(vdso, "__vdso_clock_gettime");
  return clock == nullptr ? clock_gettime : reinterpret_cast<SystemClock>(clock);
}

/* One moment, as both clocks give it. */
struct Moment {
  uint64_t cycles, nanoseconds;
};

/* Of several readings, the one that took least: an interruption falls into none of it. */
Moment currentMoment() {
  Moment best{};
  uint64_t least = UINT64_MAX;
  for (int i = 0; i < 16; ++i) {
    const uint64_t before = __rdtsc();
    const uint64_t nanoseconds = readClock(CLOCK_MONOTONIC);
    const uint64_t took = __rdtsc() - before;
    if (took >= least) continue;
    least = took;
    best = {before + took / 2, nanoseconds};
  }
  return best;
}

/* From cycles to nanoseconds: (cycles * multiplier >> kShift) + offset. */
constexpr unsigned kShift = 32;
struct Scale {
  bool counter = false; /* the processor's, or nanoseconds already */
  uint64_t multiplier = uint64_t{1} << kShift;
  uint64_t offset = 0;

  uint64_t toNanoseconds(uint64_t cycles) const {
    using Wide = unsigned __int128;
    return static_cast<uint64_t>(Wide{cycles} * multiplier >> kShift) + offset;
  }
};

bool kernelGoesByCounter() {
  std::ifstream file("/sys/devices/system/clocksource/clocksource0/current_clocksource");
  std::string name;
  return file >> name && name == "tsc";
}

Scale measuredScale() {
  constexpr uint64_t kMeasured = 2'000'000; /* ns; the readings are exact to some ten */
  Scale scale;
  if (!kernelGoesByCounter()) return scale;
  const Moment start = currentMoment();
  while (readClock(CLOCK_MONOTONIC) - start.nanoseconds < kMeasured) {
  }
  const Moment end = currentMoment();
  scale.counter = true;
  scale.multiplier =
      ((end.nanoseconds - start.nanoseconds) << kShift) / (end.cycles - start.cycles);
  scale.offset = 0;
  scale.offset = end.nanoseconds - scale.toNanoseconds(end.cycles);
  return scale;
}

constinit Scale scale;

/* Before main, while there is one thread; until then the monotonic clock serves. */
[[maybe_unused]] const bool madeReady =
    (systemClock = kernelsClock(), scale = measuredScale(), true);

}  // namespace

uint64_t tickInterval() {
  timespec interval{};
  clock_getres(CLOCK_MONOTONIC_COARSE, &interval);
  return static_cast<uint64_t>(interval.tv_sec) * kSecond + static_cast<uint64_t>(interval.tv_nsec);
}

}  // namespace host

extern "C" uint64_t zel_GetTimerCycles(void) {
  return host::scale.counter ? __rdtsc() : host::readClock(CLOCK_MONOTONIC);
}

extern "C" uint64_t zel_TimerTCToNS(uint64_t cycles) {
  return host::scale.toNanoseconds(cycles);
}
