/* The two strategies that every test can use; no lock, one thread. */
#include "sim/strategy.h"

namespace sim {

Fiber &RunOn::next(std::span<Fiber *const> runnable, Fiber *current) {
  return current ? *current : *runnable.front();
}

size_t RunOn::pick(size_t) {
  return 0;
}

Fiber &RandomWalk::next(std::span<Fiber *const> runnable, Fiber *current) {
  if (runnable.size() == 1) return *runnable.front();
  if (current && every_ > 1 && random_.below(every_) != 0) return *current;
  return *runnable[random_.below(runnable.size())];
}

}  // namespace sim
