/* The simulated machine: fibers under one seeded scheduler, virtual time, a history of the platform
 * calls, and failures on demand. Spinlocks, worlds, mutexes, conditions and threads live on it.
 * Everything runs on one OS thread.
 *
 *   sim::Machine machine({.seed = 7, .switching = sim::Switching::Random});
 *   machine.spawn("reader", [&] { ... });
 *   machine.call("writer", [&] { ... });   // runs until the writer has ended
 *   machine.run();                         // until all is quiet
 */
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <type_traits>
#include <vector>

#include "host/tracing/tracing.h"
#include "sim/callbacks.h"
#include "sim/calls.h"
#include "sim/history.h"
#include "sim/locks.h"
#include "sim/scheduler.h"
#include "sim/worlds.h"

namespace sim {

namespace access {
class Recorder;
}

class Observer;

enum class Switching {
  WhenBlocked, /* a fiber runs until it cannot go on */
  Random,      /* at every platform call any fiber may go on; the seed decides */
};

struct Settings {
  uint64_t seed = 1;
  Switching switching = Switching::WhenBlocked;
  size_t historyLength = 4096;     /* calls that are kept; 0: none */
  uint64_t stepLimit = 20'000'000; /* of one run or call; fatal, since then it goes in circles */
  unsigned deliveryThreads = 2;    /* of the directory */
  size_t queueBound = 1024;        /* of a subscription, in calls */
  uint32_t maxAssociations = 1024; /* QXT_GetMaxAssocCount */
  bool witness = false;            /* TOLM_IsWitnessNode */
  host::TraceSettings tracing{};
};

/* A fiber that was spawned. May outlive it. */
class Task {
 public:
  bool ended() const { return *ended_; }

 private:
  friend class Machine;
  explicit Task(std::shared_ptr<bool> ended) : ended_(std::move(ended)) {}
  std::shared_ptr<bool> ended_;
};

/* What answers tolmapi_PreemptionIsPending. */
enum class Preemption { Never, Random };

class Machine {
 public:
  explicit Machine(const Settings &settings = {});
  virtual ~Machine(); /* releases what is held back, runs to quiescence; what is left is fatal */
  Machine(const Machine &) = delete;
  Machine &operator=(const Machine &) = delete;

  static Machine *existing() { return existing_; } /* null when there is none */
  static Machine &current() {
    if (!existing_) requireExisting();
    return *existing_;
  }

  const Settings &settings() const { return settings_; }

  /* ---- Running. From outside every fiber, except spawn(). ------------------------------------ */

  /* Starts a fiber; it runs in run(), step() and the like. An exception that leaves `body` comes
   * out of the function that ran it. */
  Task spawn(const std::string &name, std::function<void()> body);

  /* Runs until every fiber has ended, waits idly or is held back. Virtual time passes as sleepers
   * need it. A deadlock stops the system and says who waits for what. */
  void run();

  /* Runs at most `steps` points at which the scheduler chooses; false when all was quiet before. */
  bool step(uint64_t steps = 1);

  /* Runs until the task has ended; that it never can is fatal. */
  void finish(const Task &task);

  /* Spawns a fiber, runs until it has ended and gives its result back. Other fibers run as far as
   * the way of switching lets them. */
  template <typename Function>
  std::invoke_result_t<Function> call(const std::string &name, Function &&body) {
    if constexpr (std::is_void_v<std::invoke_result_t<Function>>) {
      finish(spawn(name, std::forward<Function>(body)));
    } else {
      std::optional<std::invoke_result_t<Function>> result;
      finish(spawn(name, [&] { result.emplace(body()); }));
      return std::move(*result);
    }
  }

  /* Fibers whose names begin so, present and future ones, do not run until released. A fiber may
   * hold itself back: it stops at its next platform call. Worlds have their world's name. */
  void hold(const std::string &namePrefix) { scheduler_.hold(namePrefix); }
  void release(const std::string &namePrefix) { scheduler_.release(namePrefix); }
  void releaseAll() { scheduler_.release(""); }

  void setSwitching(Switching switching); /* random choices start from the seed again */
  void setStrategy(std::unique_ptr<Strategy> strategy);

  std::chrono::nanoseconds now() const { return std::chrono::nanoseconds(scheduler_.now()); }

  /* Runs all that is to do within this span of virtual time, and ends at its end. */
  void advance(std::chrono::nanoseconds duration);

  /* ---- Failures and preemption. -------------------------------------------------------------- */

  static constexpr uint64_t everyFurther = UINT64_MAX;

  /* The nth use of the call from now on (1: the next) fails with `status`, and so do the count - 1
   * uses after it. Without a status: the one that calls.h names. Only for calls that can fail. */
  void failAt(Call call, uint64_t nth, uint64_t count = 1,
              std::optional<zel_Status> status = std::nullopt);
  void clearFaults();
  uint64_t uses(Call call) const { return faults_[static_cast<size_t>(call)].uses; }
  uint64_t faultsInjected() const { return faultsInjected_; }

  void setPreemption(Preemption preemption) { preemption_ = preemption; }

  /* The next `times` questions that may be answered with yes are: between two such answers a world
   * always gets a no, which does not count. */
  void forcePreemption(uint64_t times) { forcedPreemptions_ = times; }

  /* Is told of everything from now on, until another one or null takes its place. */
  void setObserver(Observer *observer) { observer_ = observer; }

  /* ---- What happened. ------------------------------------------------------------------------ */

  bool keepsHistory() const { return history_.keeps(); }
  std::vector<HistoryEntry> history() const { return history_.entries(); }
  void clearHistory() { history_.clear(); }

  /* Writes into the history that something happens on the running fiber that is no platform call: a
   * step of the test, a call into a module. `what` is a text that stays, `status` what is handed
   * over with it. */
  void note(const char *what, const Argument &argument,
            std::optional<zel_Status> status = std::nullopt);
  std::string timeline(size_t lines = 60) const { return history_.timeline(lines); }

  /* Over every choice of the scheduler and every call with its argument and result: equal for two
   * runs that took the same course. */
  uint64_t traceHash() const { return scheduler_.hash(); }
  uint64_t steps() const { return scheduler_.steps(); }

  /* All that is alive: fibers that were spawned, worlds, locks, domains, heaps with their blocks,
   * logs; a line each. Empty when everything was given back. */
  virtual std::vector<std::string> alive() const;

  /* The recorder of memory accesses. Made at the first use, at the latest when an instrumented
   * module is loaded; what happens before is not recorded. */
  access::Recorder &watch();

  /* ---- For the platform's functions. --------------------------------------------------------- */

  Scheduler &scheduler() { return scheduler_; }
  LockTable &locks() { return locks_; }
  WorldTable &worlds() { return worlds_; }
  CallbackTable &callbacks() { return callbacks_; }
  Observer *observer() { return observer_; }
  bool answersPreemption(); /* what a question that may be answered with yes gets */

 protected:
  /* Lets what is held back go, runs to quiescence, and stops the system over anything left. */
  void settleAndRequireNothingLeft();

  /* With true, fibers made so far are the host's own, which live as long as it does and are no part
   * of what is alive; with false, none is. */
  void keepFibers(bool keep);

 private:
  friend class PlatformCall;
  static void requireExisting(); /* or stops the system */

  struct Faults {
    struct Range {
      uint64_t first; /* use, counted from 1 */
      uint64_t last;
      zel_Status status;
    };
    uint64_t uses = 0;
    std::vector<Range> ranges;
  };

  inline static Machine *existing_ = nullptr;
  Settings settings_;
  Scheduler scheduler_;
  History history_;
  LockTable locks_;
  WorldTable worlds_;
  CallbackTable callbacks_;
  Observer *observer_ = nullptr;
  std::vector<Faults> faults_{callCount};
  uint64_t faultsInjected_ = 0;
  uint32_t lastOwnFiber_ = 0; /* the fibers with ids up to this are the host's own */
  Preemption preemption_ = Preemption::Never;
  uint64_t forcedPreemptions_ = 0;
  std::unique_ptr<access::Recorder> recorder_; /* goes first: it uses the scheduler */
};

}  // namespace sim
