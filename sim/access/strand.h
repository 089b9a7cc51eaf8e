/* What the recorder knows of one fiber, and the moments at which fibers do things. One OS thread, no
 * lock.
 */
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <vector>

#include "sim/access/clock.h"
#include "sim/fiber.h"

namespace sim::access {

/* An instruction of a fiber: who, when, from where, holding what. */
struct Moment {
  uint64_t step = 0; /* of the scheduler */
  const void *code = nullptr;
  uint32_t fiber = 0; /* its ID; 0: the driver, or nobody */
  uint32_t stack = 0; /* of its callers; see CallStacks */
  uint32_t locks = 0; /* see lockSet() */
};

/* The classes (lock_order.h) of the innermost four spinlocks that the fiber holds, eight bits each,
 * the innermost lowest. */
uint32_t lockSet(const Fiber &fiber);
std::string lockSetText(uint32_t set);

struct Strand {
  uint16_t slot = 0;
  uint32_t fiber = 0;
  uint32_t stack = 0; /* of calls between instrumented functions */
  Clock clock;        /* its own time is this clock's, at its slot */
  Clock unfenced;     /* what relaxed loads have seen: an acquire fence makes it known */
  Clock fenced;       /* its clock at the last release fence: what relaxed stores publish */
  bool hasFence = false;

  uint32_t time() const { return clock.at(slot); }

  /* Something has been published; what comes from now on is not part of it. */
  void tick() { clock.set(slot, time() + 1); }
};

/* Strands by slot. A slot is used again when its fiber has ended, the longest ended first and not
 * before there are `fewest` of them, and its time goes on: for the fiber that gets it, the slot's
 * earlier fiber counts as its own past, which by then is far behind. */
class Strands {
 public:
  static constexpr size_t fewest = 64;

  Strand &begin(uint32_t fiber);
  void end(Strand &strand);

 private:
  std::vector<std::unique_ptr<Strand>> strands_;
  std::deque<uint16_t> ended_;
};

}  // namespace sim::access
