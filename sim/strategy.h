/* Who decides what the simulated machine leaves open: which fiber runs next, who of several waiters
 * is told, whether a preemption is due. Everything that differs between two runs of one program
 * comes from here, so a run is repeated by repeating the answers.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "sim/random.h"

namespace sim {

class Fiber;

class Strategy {
 public:
  Strategy() = default;
  virtual ~Strategy() = default;
  Strategy(const Strategy &) = delete;
  Strategy &operator=(const Strategy &) = delete;

  /* The fiber that runs next, out of `runnable` (never empty; in the order in which they became
   * runnable). `current` is the one that ran last, null when it cannot go on. */
  virtual Fiber &next(std::span<Fiber *const> runnable, Fiber *current) = 0;

  /* Any other free choice: a number below `count`, which is at least 1. */
  virtual size_t pick(size_t count) = 0;
};

/* A fiber runs until it blocks, then comes the one that has been runnable for longest. For tests
 * that a person can follow step by step. */
class RunOn final : public Strategy {
 public:
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override;
  size_t pick(size_t count) override;
};

/* At one step in `every`, by chance, any runnable fiber, each as likely as the others; at the steps
 * between the fiber that ran last goes on, if it can. */
class RandomWalk final : public Strategy {
 public:
  explicit RandomWalk(uint64_t seed, uint32_t every = 1) : random_(seed), every_(every) {}
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override;
  size_t pick(size_t count) override { return random_.below(count); }

 private:
  Random random_;
  uint32_t every_;
};

}  // namespace sim
