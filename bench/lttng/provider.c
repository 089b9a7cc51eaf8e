/* The peer's tracepoints and its clock. A clock that stands in for the peer's own cannot be taken out
 * again, so one stands there all the time and reads either: what the peer takes as it is contains a
 * call through a pointer more, about one part in a hundred. */
#include "bench/lttng/provider.h"

#define LTTNG_UST_TRACEPOINT_CREATE_PROBES
#define LTTNG_UST_TRACEPOINT_DEFINE
#include <lttng/ust-clock.h>
#include <string.h>
#include <time.h>

#include "bench/lttng/tracepoint.h"
#include "platform/zel.h"

#define TEN_TIMES(work) work work work work work work work work work work

void benchTracepointsOn(uint64_t value) {
  TEN_TIMES(lttng_ust_tracepoint(karst_bench, on, value, value, value, 0, 0, 0);)
}

void benchTracepointsOff(uint64_t value) {
  TEN_TIMES(lttng_ust_tracepoint(karst_bench, off, value, value, value, 0, 0, 0);)
}

bool benchTracepointsAreSelected(void) {
  return lttng_ust_tracepoint_enabled(karst_bench, on) &&
         !lttng_ust_tracepoint_enabled(karst_bench, off);
}

static bool isMatched; /* set while nobody traces */

static uint64_t readClock(void) {
  if (isMatched) return zel_TimerTCToNS(zel_GetTimerCycles());
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return (uint64_t)now.tv_sec * 1000000000u + (uint64_t)now.tv_nsec;
}
static uint64_t frequency(void) {
  return 1000000000u;
}
static int uuid(char *text) {
  strcpy(text, "4b415253-5442-454e-4348-000000000001");
  return 0;
}
static const char *name(void) {
  return "bench";
}
static const char *description(void) {
  return "monotonic nanoseconds";
}

bool benchClockInstall(void) {
  return lttng_ust_trace_clock_set_read64_cb(readClock) == 0 &&
         lttng_ust_trace_clock_set_freq_cb(frequency) == 0 &&
         lttng_ust_trace_clock_set_uuid_cb(uuid) == 0 &&
         lttng_ust_trace_clock_set_name_cb(name) == 0 &&
         lttng_ust_trace_clock_set_description_cb(description) == 0 &&
         lttng_ust_enable_trace_clock_override() == 0;
}

void benchClockMatched(bool matched) {
  isMatched = matched;
}
