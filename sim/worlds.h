/* Worlds on fibers: an ID, a wait that keeps its wake-ups, a stop. One OS thread, no lock. */
#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/zel.h"
#include "sim/fiber.h"

namespace sim {

/* Lives in the heap that its creator named, until TOLM_WorldDestroy. */
struct World {
  zel_WorldID id = ZEL_NO_WORLD;
  zel_Name name{};
  zel_HeapID heap = ZEL_NO_HEAP;
  const char *reason = nullptr; /* of the wait that it is in; null while it runs */
  bool woken = false;           /* a wake-up that no wait has used up yet */
  bool stopping = false;
  bool ended = false;
  bool preemptionAnswered = false; /* the last question was answered with yes */
  WaitQueue wait{};                /* the world itself, in its wait */
  WaitQueue end{};                 /* who waits for its end */

  bool idle() const { return ended || (reason && !woken && !stopping); }
  std::string describe() const;
};

struct WorldTable {
  std::map<zel_WorldID, World *> worlds;
  zel_WorldID lastID = ZEL_NO_WORLD;
  uint64_t activity = 0; /* sleeps begun and ended */
  WaitQueue settled{};   /* who waits for all worlds to be idle */

  bool allIdle() const;
  std::vector<std::string> alive() const; /* "world X (waits: Y)", a line each */
};

}  // namespace sim
