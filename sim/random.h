/* Chance from a seed, the same on every machine. No lock. */
#pragma once

#include <cstddef>
#include <cstdint>

namespace sim {

/* splitmix64 */
class Random {
 public:
  explicit Random(uint64_t seed) : state_(seed) {}

  uint64_t next() {
    uint64_t z = (state_ += 0x9e3779b97f4a7c15u);
    z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9u;
    z = (z ^ (z >> 27)) * 0x94d049bb133111ebu;
    return z ^ (z >> 31);
  }

  /* A number below `count`, which is at least 1. */
  size_t below(size_t count) {
    /* The high word of a product instead of a remainder: no division on the hottest path. */
    return static_cast<size_t>((static_cast<unsigned __int128>(next()) * count) >> 64);
  }

 private:
  uint64_t state_;
};

}  // namespace sim
