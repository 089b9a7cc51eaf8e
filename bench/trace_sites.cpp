/* Trace statements as the module has them: its macro, its emission and its compiler flags, in a
 * shared object that finds the host's functions where the module finds them. */
#include "bench/trace_sites.h"

#include "karst_resolver/trace.h"

#define TEN_TIMES(work) work work work work work work work work work work
#define EXPORTED __attribute__((visibility("default")))

static __attribute__((noinline)) void emptyCall() {
  asm volatile("");
}

EXPORTED void benchTraceSites(uint64_t value) {
  TEN_TIMES(KARST_RESOLVER_TRACE(SetCallback, 621, value, value, value);)
}

EXPORTED void benchEmptyCalls(uint64_t) {
  TEN_TIMES(emptyCall();)
}

EXPORTED void benchNothing(uint64_t) {
  TEN_TIMES(asm volatile("");)
}
