/* Spinlocks and lock domains on fibers. A fiber that finds a lock held is parked, so no time is
 * spent spinning; every waiter may be the next holder, as on a real machine. One OS thread, no
 * lock.
 */
#pragma once

#include <string>
#include <vector>

#include "platform/zel.h"
#include "sim/fiber.h"

namespace sim {

struct LockDomain;

/* Lives in the heap that its creator named. */
struct Spinlock {
  static constexpr uint64_t alive = 0x6b636f6c6e697073; /* "spinlock" */

  uint64_t tag = alive;
  zel_Name name{};
  uint16_t rank = 0;
  zel_HeapID heap = ZEL_NO_HEAP;
  uint8_t lockClass = 0; /* of its name; see lock_order.h */
  LockDomain *domain = nullptr;
  Fiber *holder = nullptr;
  WaitQueue waiters{};
};

/* The lock domains of one machine, and through them its locks. */
struct LockTable {
  std::vector<LockDomain *> domains;
  std::vector<std::string> alive() const; /* "lock X in domain Y", a line each */
};

/* Stops the system when the fiber holds a spinlock: "<fiber> <doing> [<what>] while ...". */
void requireNoSpinlock(const Fiber &fiber, const char *doing, const char *what = nullptr);

}  // namespace sim
