/* What bench/trace.cpp calls in the shared object of trace statements: each function does its work
 * ten times, so that the call of it hardly counts. */
#pragma once

#include <cstdint>

extern "C" {
void benchTraceSites(uint64_t value);
void benchEmptyCalls(uint64_t value);
void benchNothing(uint64_t value);
}
