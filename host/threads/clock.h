/* What the host itself knows of time, besides the platform's timer. No lock. */
#pragma once

#include <cstdint>

namespace host {

/* Nanoseconds of the machine's monotonic clock at its last tick: up to tickInterval() behind the
 * clock, and read at a fraction of its cost. */
uint64_t tickNanoseconds();
uint64_t tickInterval();

}  // namespace host
