/* The clock by which the benchmarks measure. */
#pragma once

#include <chrono>

namespace bench {

using Clock = std::chrono::steady_clock;

}  // namespace bench
