/* From a case that fails to a small one that fails in the same way. One thread, and children that
 * play.
 */
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "sim/explore/case.h"
#include "sim/explore/crew.h"
#include "sim/explore/search.h"

namespace sim {

/* Leaves out what is not needed: operations, then faults, then deviations from the default schedule
 * (Zeller, Hildebrandt: Simplifying and Isolating Failure-Inducing Input, IEEE TSE 2002). Where a
 * plan without some of its operations does not fail by the schedule that was found, other schedules
 * of it are tried. */
class Shortener {
 public:
  struct Limits {
    uint64_t runs = 4000;
    std::chrono::seconds time{60};
  };
  /* `progress` is told what was achieved so far, a line each time. */
  Shortener(Crew &crew, const Playing &playing, const Limits &limits,
            std::function<void(const std::string &)> progress);

  /* The case with the schedule that it takes written down; nothing when it does not fail as it did,
   * played alone. */
  std::optional<Case> fix(const Found &found);

  /* The smallest case that was found within the limits, with its schedule. `fixed` comes from
   * fix(). */
  Case shorten(Case fixed);

  uint64_t runs() const { return runs_; }

 private:
  using Attempt = std::function<Case(size_t)>;

  bool exhausted() const;
  std::optional<size_t> firstFailure(size_t count, const Attempt &attempt);
  std::optional<Case> recorded(const Case &played);
  bool tryAll(Case &best, size_t count, const Attempt &attempt);
  template <typename Item>
  bool leaveOut(Case &best, std::vector<Item> &(*items)(Case &), size_t schedules);
  void simplerSchedule(Case &best);
  void tell(const Case &best) const;

  Crew &crew_;
  Playing playing_;
  Limits limits_;
  std::function<void(const std::string &)> progress_;
  std::chrono::steady_clock::time_point began_;
  std::string kind_; /* of failure that is wanted */
  ScheduleLog log_;
  uint64_t runs_ = 0;
};

}  // namespace sim
