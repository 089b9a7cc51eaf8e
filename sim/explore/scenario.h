/* What the explorer runs: a scenario turns a seed into a plan, and plays a plan on a machine. A plan is
 * data, so that it can be shortened, written down and played again. One OS thread, no lock.
 */
#pragma once

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "sim/calls.h"
#include "sim/machine.h"
#include "sim/strategy.h"

namespace sim {

/* One thing that somebody does. */
struct Operation {
  uint8_t phase = 0; /* operations of one phase overlap; between phases all comes to rest */
  uint8_t actor = 0; /* the fiber that does it; an actor's operations follow each other */
  uint8_t kind = 0;  /* the scenario's own numbering */
  uint8_t a = 0, b = 0, c = 0;
  bool operator==(const Operation &) const = default;
};

/* The nth use of the call, counted from the start of the first phase, and the count - 1 after it
 * fail. */
struct PlannedFault {
  Call call{};
  uint32_t nth = 1;
  uint32_t count = 1;
  bool operator==(const PlannedFault &) const = default;
};

struct Plan {
  std::vector<Operation> operations; /* in ascending order of phase */
  std::vector<PlannedFault> faults;
  bool operator==(const Plan &) const = default;
};

/* What a run has come to. */
struct Outcome {
  uint64_t steps = 0;      /* of the scheduler */
  uint64_t hash = 0;       /* of its course */
  uint64_t operations = 0; /* done, of the plan's */
  uint64_t faults = 0;     /* injected */
  uint64_t checks = 0;     /* comparisons with the model that were made */
};

/* One run of a scenario: what it is to use. */
struct Run {
  uint64_t seed = 1;            /* of everything but the schedule that is left to chance */
  std::filesystem::path module; /* the object to load */
  Strategy *strategy = nullptr; /* decides from the first step on */
  size_t historyLength = 4096;
  uint64_t stepLimit = 20'000'000; /* fatal: it goes in circles */
};

class Scenario {
 public:
  Scenario() = default;
  virtual ~Scenario() = default;
  Scenario(const Scenario &) = delete;
  Scenario &operator=(const Scenario &) = delete;

  virtual std::string name() const = 0;                /* "churn": one word */
  virtual std::string about() const = 0;               /* one line */
  virtual bool small() const = 0;                      /* fit for exhaustive search */
  virtual std::vector<std::string> actors() const = 0; /* their names, by number */

  /* The same for the same arguments. About `length` operations; 0: the scenario's own number. */
  virtual Plan plan(uint64_t seed, size_t length) const = 0;

  virtual std::string describe(const Operation &operation) const = 0; /* "remove node 2" */

  /* Plays any plan, also one that plan() would not make: operations that make no sense where they
   * stand do nothing. Whatever must hold and does not stops the system (host::panic). */
  virtual Outcome play(const Plan &plan, const Run &run) const = 0;
};

/* Lets somebody else's strategy decide; the machine owns this one. */
class Borrowed final : public Strategy {
 public:
  explicit Borrowed(Strategy &lender) : lender_(lender) {}
  Fiber &next(std::span<Fiber *const> runnable, Fiber *current) override {
    return lender_.next(runnable, current);
  }
  size_t pick(size_t count) override { return lender_.pick(count); }

 private:
  Strategy &lender_;
};

}  // namespace sim
