/* What the shared object of the peer's tracepoints exports; loaded once the session daemon runs. */
#ifndef BENCH_LTTNG_PROVIDER_H
#define BENCH_LTTNG_PROVIDER_H

#include <stdbool.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Ten tracepoints each, one that a session selects and one that none does. */
void benchTracepointsOn(uint64_t value);
void benchTracepointsOff(uint64_t value);
bool benchTracepointsAreSelected(void); /* the first are, the others are not */

/* Puts a clock of ours in the place of the peer's, for good; at first it reads what the peer's own
 * does. False when the peer has refused it. */
bool benchClockInstall(void);
void benchClockMatched(bool matched); /* it reads the host's timer, as our records do */

#ifdef __cplusplus
}
#endif

#endif
