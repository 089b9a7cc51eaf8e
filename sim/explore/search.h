/* The search: runs without end, each in a child, until one fails or the budget is spent. One thread
 * in each process; the counters are shared and atomic.
 */
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "sim/explore/case.h"
#include "sim/explore/crew.h"
#include "sim/explore/shared.h"
#include "sim/sketch.h"

namespace sim {

/* A case that failed, and how. */
struct Found {
  Case failing;
  Failure failure;
};

/* What was done. */
struct Figures {
  uint64_t runs = 0;
  uint64_t steps = 0;
  uint64_t operations = 0;
  uint64_t faults = 0;
  uint64_t checks = 0;
  double processorSeconds = 0;
  double courses = 0;     /* distinct ones, about */
  double successions = 0; /* a fiber's call directly behind another's: distinct pairs, about */
};

/* What one scenario had of it. */
struct Share {
  const Scenario *scenario;
  uint64_t runs = 0;
  uint64_t steps = 0;
  double processorSeconds = 0;
};

/* An exhaustive search of one plan. */
struct Exhausted {
  std::string scenario;
  uint64_t seed;
  uint32_t preemptions;
  uint64_t schedules; /* played */
  bool complete;      /* there are no others */
};

struct Budget {
  uint64_t runs = UINT64_MAX;
  uint64_t steps = UINT64_MAX;
};

class Search {
 public:
  /* `tick` is called about once a second. `length`: operations of a plan, 0 for the scenario's own
   * number. */
  Search(Crew &crew, const Playing &playing, size_t length, std::function<void()> tick);

  /* What is searched by chance: run i plays scenario i, i + 1, ... of the list in turn, with the
   * seed `seed` + i; strategies change after each round of the scenarios. With `twice`, each run is
   * made twice and must take the same course. */
  struct Chances {
    std::vector<const Scenario *> scenarios;
    std::vector<StrategyName> strategies;
    uint64_t seed = 1;
    bool twice = false;
  };

  /* Plays until the budget is spent on top of what was spent before. */
  std::optional<Found> byChance(const Chances &chances, const Budget &budget);

  /* Plays every schedule of one plan with at most 0, 1, ... `preemptions` preemptions. */
  std::optional<Found> exhaust(const Scenario &scenario, uint64_t seed, uint32_t preemptions,
                               const Budget &budget);

  /* Gives the strategies that need it the length of a run, in choices: that of the scenario's plan
   * from seed 1 by default schedule, rounded up to a power of two. A failure of that run is one. */
  std::optional<Found> measure(const std::vector<const Scenario *> &scenarios);
  StrategyName complete(StrategyName strategy, const Scenario &scenario) const;

  Figures figures() const;
  std::vector<Share> shares() const; /* of the scenarios that were played, in the order of that */
  const std::vector<Exhausted> &exhausted() const { return exhausted_; }

 private:
  static constexpr uint32_t mostPreemptions = 8;
  static constexpr size_t mostScenarios = 64;

  /* One member's; the others only read. */
  struct Slot {
    std::atomic<uint64_t> run;
    std::atomic<uint64_t> processorNanoseconds; /* of this process, by the end of its last run */
    std::array<std::atomic<uint64_t>, mostPreemptions + 1> schedules;
    std::array<std::atomic<bool>, mostPreemptions + 1> complete;
  };
  struct Account {
    std::atomic<uint64_t> runs, steps, processorNanoseconds;
  };
  struct Board {
    std::atomic<uint64_t> next; /* the run that is to be played next */
    std::atomic<uint64_t> runs, steps, operations, faults, checks;
    std::atomic<uint64_t> processorNanoseconds; /* of all children */
    std::array<Account, mostScenarios> accounts;
    std::array<Slot, 256> slots;
    Sketch courses;
    Sketch successions;
  };

  Case caseOf(const Chances &chances, uint64_t run) const;
  void playRuns(const Chances &chances, uint64_t runs, Slot &slot);
  void playSchedules(const Case &searched, uint32_t share, uint32_t preemptions);
  void count(const Scenario &scenario, const Outcome &outcome, Slot &slot);
  void openAccount(const Scenario &scenario); /* before it is played */
  void begin(const Budget &budget);
  bool spent() const { return board_->runs >= end_.runs || board_->steps >= end_.steps; }
  struct Fallen {
    unsigned member;
    Failure failure;
  };
  std::optional<Fallen> watch();

  Crew &crew_;
  Playing playing_;
  size_t length_;
  std::function<void()> tick_;
  Budget end_;
  Shared<Board> board_;
  std::map<const Scenario *, uint32_t> lengths_;
  std::vector<const Scenario *> accounts_;         /* whose is which on the board */
  std::vector<std::unique_ptr<ScheduleLog>> logs_; /* one a member */
  std::vector<Exhausted> exhausted_;
};

}  // namespace sim
