/* The scheduler: fibers, virtual time, and the points at which another fiber may go on. One OS
 * thread; whatever runs outside every fiber (a test's own code) is the driver, which is never
 * switched away from but lets the fibers run whenever it has to wait itself.
 */
#pragma once

#include <cstdint>
#include <exception>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "sim/fiber.h"
#include "sim/strategy.h"

namespace sim {

class Scheduler {
 public:
  explicit Scheduler(std::unique_ptr<Strategy> strategy);
  ~Scheduler(); /* fibers that have not ended are abandoned where they are */
  Scheduler(const Scheduler &) = delete;
  Scheduler &operator=(const Scheduler &) = delete;

  /* The one that exists; null when none does. */
  static Scheduler *current() { return instance_; }

  /* ---- What runs on the machine asks. -------------------------------------------------------- */

  Fiber &running() { return *current_; }
  bool driving() const { return current_ == &driver_; }

  /* A new fiber, runnable at once. `onEnd` is its last act, also when `body` throws. */
  Fiber &spawn(const std::string &name, std::function<void()> body,
               std::function<void()> onEnd = {});

  /* Another fiber may go on here. */
  void point() {
    if (driving()) return;
    ++steps_;
    if (steps_ >= pause_ || current_->heldBack_) return leave();
    Fiber &next = strategy_->next(runnable_, current_);
    mix(next.id());
    if (&next != current_) switchTo(next);
  }

  /* Parks the running fiber until it is woken, or until wait.until: then the result is false. The
   * driver runs the others meanwhile. */
  bool block(WaitQueue &queue, const Wait &wait);
  void sleep(uint64_t nanoseconds);
  void wakeAll(WaitQueue &queue);
  void wakeAny(WaitQueue &queue); /* one of them, the strategy says which */

  size_t pick(size_t count); /* a free choice that is not one of fibers */

  uint64_t now() const { return now_; } /* virtual nanoseconds */

  /* ---- What the driver asks; not from a fiber. ----------------------------------------------- */

  /* What ends a drive before all is quiet. */
  struct Limits {
    const bool *until = nullptr; /* somebody set this */
    uint64_t steps = UINT64_MAX; /* so many points have been passed */
    uint64_t time = never;       /* nothing is left to do before this time; it is now */
  };
  enum class Stop { Quiet, Until, Steps, Time };

  /* Lets fibers run. Quiet: every fiber has ended, waits idly, or is held back. Fibers that wait in
   * vain stop the system with a report. An exception that leaves a fiber comes out here. */
  Stop drive(const Limits &limits);

  /* Fibers whose names begin so, now or later, do not run until they are released. */
  void hold(const std::string &namePrefix);
  void release(const std::string &namePrefix); /* empty: all */

  void setStrategy(std::unique_ptr<Strategy> strategy) { strategy_ = std::move(strategy); }
  void setStepLimit(uint64_t steps) { stepLimit_ = steps; } /* of one drive; fatal */

  uint64_t steps() const { return steps_; }
  uint64_t hash() const { return hash_; }
  void mix(uint64_t value) { hash_ = (hash_ ^ value) * 0x9e3779b97f4a7c15u + (hash_ >> 29); }

  /* Every fiber that has not ended, oldest first. */
  const std::vector<std::unique_ptr<Fiber>> &fibers() const { return fibers_; }

  [[noreturn]] void reportDeadlock(const char *headline) const;

 private:
  static constexpr uint64_t noPause = UINT64_MAX;

  void enqueue(WaitQueue &queue, Fiber &fiber);
  void unqueue(Fiber &fiber);
  void setReady(Fiber &fiber);
  void addRunnable(Fiber &fiber);
  void removeRunnable(Fiber &fiber);
  Fiber *choose();            /* null: nobody can run */
  void leave();               /* the running fiber cannot go on: choose another, or the driver */
  void switchTo(Fiber &next); /* returns when the fiber that called goes on */
  void landed(Fiber &previous, void *context); /* first thing after a switch: who was left, where */
  [[noreturn]] void runBody();
  void reap(Fiber &fiber);
  bool advanceTime(uint64_t limit); /* to the next sleeper's time; false: none up to the limit */
  bool stuck() const;               /* somebody waits and nobody is left who could end that */
  bool heldByName(const Fiber &fiber) const;
  friend struct FiberEntry;

  inline static Scheduler *instance_ = nullptr;
  std::unique_ptr<Strategy> strategy_;
  void *const exceptionState_; /* the C++ runtime's, of the one thread; see Fiber */
  Fiber driver_;
  Fiber *current_ = &driver_;
  Fiber *last_ = nullptr; /* the fiber that ran before the driver, while it can go on */
  uint64_t steps_ = 0;
  uint64_t pause_ = noPause; /* the driver goes on at this step */
  uint64_t stepLimit_ = noPause;
  uint64_t hash_ = 0x243f6a8885a308d3u;
  uint64_t now_ = 0;
  uint32_t lastId_ = 0;
  std::vector<Fiber *> runnable_; /* ready and not held back, longest first */
  std::vector<std::unique_ptr<Fiber>> fibers_;
  std::vector<std::string> heldPrefixes_;
  std::exception_ptr escaped_;
};

}  // namespace sim
