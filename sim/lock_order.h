/* The order in which locks are taken: a graph over all runs of the process, in which an edge from A
 * to B says that somebody has taken, or waited for, B while he was inside A. A cycle is a deadlock
 * that only waits for its schedule, and stops the system. Besides spinlocks, by name, whatever else
 * fibers wait for each other at is a node: a world's body, a status callback, a client's callback.
 * One OS thread, no lock.
 */
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "sim/fiber.h"

namespace sim {

class LockOrder {
 public:
  /* The number of a class of locks, from 1 on: all locks of a name are one class. */
  static uint8_t classOf(std::string_view name);
  static std::string name(uint32_t lockClass);

  /* The fiber is about to take, or to wait for, a lock of the class. */
  static void requireOrder(const Fiber &fiber, uint8_t lockClass);
};

/* A fiber is inside something that is no spinlock but that others may wait for. */
class Inside {
 public:
  Inside(Fiber &fiber, std::string_view what);
  ~Inside();
  Inside(const Inside &) = delete;
  Inside &operator=(const Inside &) = delete;

 private:
  Fiber &fiber_;
};

/* The names of such things. */
inline constexpr const char *insideStatusCallback = "a status callback";
inline constexpr const char *insideClientCallback = "a client's callback";
std::string insideWorld(const char *name);

}  // namespace sim
