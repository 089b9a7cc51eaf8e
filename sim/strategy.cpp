/* The two strategies that every test can use; no lock, one thread. */
#include "sim/strategy.h"

namespace sim {

Fiber &RunOn::next(std::span<Fiber *const> runnable, Fiber *current) {
  return current ? *current : *runnable.front();
}

size_t RunOn::pick(size_t) {
  return 0;
}

Fiber &RandomWalk::next(std::span<Fiber *const> runnable, Fiber *) {
  return *runnable[pick(runnable.size())];
}

size_t RandomWalk::pick(size_t count) {
  /* The high word of a product instead of a remainder: no division on the hottest path. */
  return static_cast<size_t>((static_cast<unsigned __int128>(random()) * count) >> 64);
}

uint64_t RandomWalk::random() {
  uint64_t z = (state_ += 0x9e3779b97f4a7c15u);
  z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9u;
  z = (z ^ (z >> 27)) * 0x94d049bb133111ebu;
  return z ^ (z >> 31);
}

}  // namespace sim
