/* A case: everything that a run depends on, and the text from which it can be played again. One OS
 * thread, no lock.
 */
#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "sim/explore/scenario.h"
#include "sim/explore/strategies.h"

namespace sim {

struct Case {
  const Scenario *scenario = nullptr;
  uint64_t seed = 1;         /* of all that is left to chance but the schedule */
  uint64_t strategySeed = 1; /* the same number, unless other schedules of the plan are tried */
  StrategyName strategy;
  std::optional<Schedule> schedule; /* decides instead of the strategy */
  Plan plan;
};

/* The case that follows from one number. `length`: operations, 0 for the scenario's own number. */
Case makeCase(const Scenario &scenario, uint64_t seed, const StrategyName &strategy, size_t length);

/* What is the same for many cases. */
struct Playing {
  std::filesystem::path module;
  size_t historyLength = 0; /* in calls; what fails is played once more with one */
};

/* Plays the case in this process. Where it leaves the default schedule is noted in `log`, unless
 * that is null. */
Outcome play(const Case &played, const Playing &playing, ScheduleLog *log = nullptr);

/* Operations: twelve hexadecimal digits each. Faults: "zel_HeapAllocWithRA:3:1", the call, its nth
 * use, the count. Schedule: "choice:answer". Full stops between them; "-" when there is none. What
 * reads throws std::invalid_argument. */
std::string textOf(const std::vector<Operation> &operations);
std::string textOf(const std::vector<PlannedFault> &faults);
std::string textOf(const Schedule &schedule);
std::vector<Operation> operationsFrom(const std::string &text);
std::vector<PlannedFault> faultsFrom(const std::string &text);
Schedule scheduleFrom(const std::string &text);

/* The options with which the command plays this case: by its seed and strategy while it has no
 * schedule of its own, else by plan and schedule. */
std::string replayOptions(const Case &played, size_t length);

}  // namespace sim
