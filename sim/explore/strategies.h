/* Schedules that are searched for faults, written down and played again. A choice is a step at which
 * more than one answer was possible; choices are counted from 0 in the order in which a run comes to
 * them. One OS thread, no lock.
 */
#pragma once

#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include "sim/explore/shared.h"
#include "sim/random.h"
#include "sim/strategy.h"

namespace sim {

/* A choice at which a run left the default, which is RunOn: the fiber's id, or the value picked. */
struct Deviation {
  uint32_t choice;
  uint32_t answer;
  bool operator==(const Deviation &) const = default;
};
using Schedule = std::vector<Deviation>; /* in ascending order of choice */

/* Where a run notes its deviations: memory that outlives the process that wrote it. */
class ScheduleLog {
 public:
  void clear() { data_->count = data_->choices = 0; }
  void passed() { ++data_->choices; }
  void add(Deviation deviation) {
    if (data_->count < capacity) data_->deviations[data_->count] = deviation;
    ++data_->count;
  }
  bool complete() const { return data_->count <= capacity; }
  uint32_t choices() const { return data_->choices; } /* that the run had, deviations among them */
  Schedule schedule() const;

 private:
  static constexpr uint32_t capacity = 1u << 24;
  struct Data {
    uint32_t count;
    uint32_t choices;
    Deviation deviations[capacity];
  };
  Shared<Data> data_;
};

/* Lets another strategy decide and notes where that left the default. */
class Recorder final : public Strategy {
 public:
  Recorder(Strategy &decides, ScheduleLog &log) : decides_(decides), log_(log) {}
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override;
  size_t pick(size_t count) override;

 private:
  void note(bool deviates, uint64_t answer);
  Strategy &decides_;
  ScheduleLog &log_;
};

/* Plays a schedule. An answer that is not possible where it stands (the plan was changed since) is
 * passed over. */
class Replay final : public Strategy {
 public:
  explicit Replay(Schedule schedule) : schedule_(std::move(schedule)) {}
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override;
  size_t pick(size_t count) override;

 private:
  const Deviation *due(); /* the deviation of the choice that is being made; null: none */
  Schedule schedule_;
  size_t place_ = 0;
  uint32_t choice_ = 0;
};

/* Probabilistic concurrency testing (Burckhardt, Kothari, Musuvathi, Nagarakatte: A Randomized
 * Scheduler with Probabilistic Guarantees of Finding Bugs, ASPLOS 2010). Fibers have priorities by
 * chance, the highest runs; at depth - 1 choices out of `length`, by chance, the one that would run
 * falls below all the others. A bug that needs `depth` ordered events is found by one run in
 * fibers * length^(depth - 1) at least. A fiber that runs for longer than a whole run should take
 * goes in circles and falls too. */
class Pct final : public Strategy {
 public:
  Pct(uint64_t seed, uint32_t depth, uint32_t length);
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override;
  size_t pick(size_t count) override { return random_.below(count); }

 private:
  struct Change {
    uint32_t choice;
    uint64_t priority;
  };
  Fiber &highest(std::span<Fiber *const> runnable);
  uint64_t &priorityOf(const Fiber &fiber);

  Random random_;
  std::vector<Change> changes_;      /* the next one last */
  std::vector<uint64_t> priorities_; /* by a fiber's id; 0: not seen yet */
  uint64_t floor_;                   /* below every priority given so far */
  uint32_t choice_ = 0;
  uint32_t patience_;
  uint32_t streak_ = 0; /* choices since another fiber was chosen */
  uint32_t streakOf_ = 0;
};

/* All schedules with at most so many preemptions, one a run, depth first (Musuvathi, Qadeer:
 * Iterative Context Bounding for Systematic Testing of Multithreaded Programs, PLDI 2007). Choices
 * where the last fiber cannot go on, and picked values, are free; a switch away from a fiber that
 * could go on is a preemption. Several searches can share the work: each schedule belongs to one of
 * them by the place of its first deviation. */
class BoundedSearch final : public Strategy {
 public:
  explicit BoundedSearch(uint32_t preemptions, uint32_t share = 0, uint32_t shares = 1);
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override;
  size_t pick(size_t count) override;

  /* After a run: on to the next schedule; false when that was the last one. The first run plays the
   * default, which every share has to but only the first one owns. */
  bool advance();
  bool owned() const { return share_ == 0 || deviating_; }

 private:
  struct Choice {
    uint32_t number;
    uint32_t answers; /* that are possible */
    uint32_t taken;   /* 0: the default */
    bool preempts;    /* any but the default */
  };
  uint32_t decide(uint32_t answers, bool preempts);
  bool mayTake(const Choice &choice, bool first) const;

  uint32_t bound_;
  uint32_t share_;
  uint32_t shares_;
  std::vector<Choice> path_; /* choices that are open: another answer is within the bound */
  bool deviating_ = false;   /* the path is not the default */
  size_t passed_ = 0;        /* of the path, in this run */
  uint32_t choice_ = 0;
  uint32_t preemptions_ = 0;
};

/* A strategy by name: "default" (RunOn), "random", "random:32" (a switch every 32 choices), "pct:3" (depth), "pct:3:5000"
 * (and length), "exhaustive:2" (preemptions). */
struct StrategyName {
  enum class Kind : uint8_t { Default, Random, Pct, Exhaustive };
  Kind kind = Kind::Default;
  uint32_t parameter = 1;
  uint32_t length = 0; /* of a run in choices, for Pct; 0: to be measured */
  bool operator==(const StrategyName &) const = default;

  std::string toString() const;
  static StrategyName parse(const std::string &text); /* throws std::invalid_argument */

  /* Says all that decides a run: not so Exhaustive, which is many, and Pct without a length. */
  bool isOneRun() const;
  std::unique_ptr<Strategy> make(uint64_t seed) const;
};

}  // namespace sim
