/* The timer counter of the platform: nanoseconds of the machine's monotonic clock. No lock.
 *
 * The clock is read through the vDSO, which scales the processor's counter itself; a calibration of
 * our own would only add a second, less exact opinion on what time it is.
 */
#include <ctime>

#include "platform/zel.h"

extern "C" uint64_t zel_GetTimerCycles(void) {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<uint64_t>(now.tv_sec) * 1'000'000'000u + static_cast<uint64_t>(now.tv_nsec);
}

extern "C" uint64_t zel_TimerTCToNS(uint64_t cycles) {
  return cycles;
}
