/* What the host itself knows of time, besides the platform's timer. No lock. */
#pragma once

#include <cstdint>
#include <ctime>

namespace host {

/* clock_gettime without the C library's call around it: the system's own function. The simulator has
 * one that tells its virtual time. */
using SystemClock = int (*)(clockid_t clock, timespec *now);
extern SystemClock systemClock;

/* Nanoseconds. In line, for some are asked at every event of a trace. */
inline uint64_t readClock(clockid_t clock) {
  timespec now;
  systemClock(clock, &now);
  return static_cast<uint64_t>(now.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(now.tv_nsec);
}

/* Nanoseconds of the machine's monotonic clock at its last tick: up to tickInterval() behind the
 * clock, and read at a fraction of its cost. */
inline uint64_t tickNanoseconds() {
  return readClock(CLOCK_MONOTONIC_COARSE);
}
uint64_t tickInterval();

}  // namespace host
