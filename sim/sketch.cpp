/* The sketch's arithmetic. No lock. */
#include "sim/sketch.h"

#include <bit>
#include <cmath>

#include "sim/random.h"

namespace sim {

void Sketch::add(uint64_t value) {
  const uint64_t hash = Random(value).next();
  std::atomic<uint8_t> &place = registers_[hash >> (64 - indexBits)];
  const auto rank = static_cast<uint8_t>(std::countl_zero(hash << indexBits | 1) + 1);
  uint8_t most = place.load(std::memory_order_relaxed);
  while (most < rank && !place.compare_exchange_weak(most, rank, std::memory_order_relaxed)) {
  }
}

double Sketch::count() const {
  constexpr double places = double{1 << indexBits};
  double sum = 0;
  double empty = 0;
  for (const std::atomic<uint8_t> &place : registers_) {
    const uint8_t rank = place.load(std::memory_order_relaxed);
    sum += std::ldexp(1.0, -rank);
    if (rank == 0) ++empty;
  }
  const double estimate = 0.7213 / (1 + 1.079 / places) * places * places / sum;
  if (estimate <= 2.5 * places && empty > 0) return places * std::log(places / empty);
  return estimate;
}

}  // namespace sim
