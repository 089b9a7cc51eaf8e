/* One fiber: a stack of its own, what it waits for, which locks it holds. One OS thread runs all
 * fibers, so nothing here is locked.
 */
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace sim {

class Fiber;
struct Spinlock;
struct World;
namespace access {
struct Strand;
}

inline constexpr uint64_t never = UINT64_MAX; /* a virtual time that does not come */

/* Why a fiber does not run: "waits for <what> <object>, held by <holder>". The texts stay valid for
 * as long as the fiber waits. */
struct Wait {
  const char *what;
  const char *object = nullptr;
  const Fiber *holder = nullptr;
  bool idle = false;      /* waits for work that may never come, so this is no deadlock */
  uint64_t until = never; /* virtual nanoseconds at which it goes on by itself */
};

/* Fibers that wait for the same thing, first come first. */
struct WaitQueue {
  Fiber *first = nullptr;
  Fiber *last = nullptr;
};

/* A stack with a guard page below it. One whose fiber has ended serves the next one, also on the
 * next machine. */
class Stack {
 public:
  static std::unique_ptr<Stack> take();
  static void giveBack(std::unique_ptr<Stack> stack);
  Stack();
  ~Stack();
  Stack(const Stack &) = delete;
  Stack &operator=(const Stack &) = delete;
  void *top() const { return top_; }
  void *bottom() const { return bottom_; } /* the guard page lies below */
  size_t size() const { return static_cast<size_t>(top_ - bottom_); }

 private:
  inline static std::vector<std::unique_ptr<Stack>> spare_;
  char *bottom_;
  char *top_;
};

class Fiber {
 public:
  uint32_t id() const { return id_; } /* 1, 2, ... in the order of their making */
  const std::string &name() const { return *name_; }
  uint64_t nameHash() const { return nameHash_; }

  World *world = nullptr; /* the world that this fiber is the body of */

  /* Spinlocks held, in the order taken. Ranks rise, so there are never many. */
  std::array<Spinlock *, 16> held{};
  uint32_t heldCount = 0;

  /* What else it is inside of that others may wait for, by class (lock_order.h), outermost first. */
  std::array<uint8_t, 8> inside{};
  uint32_t insideCount = 0;

  mutable access::Strand *strand = nullptr; /* what the recorder of its accesses keeps; or null */

  uint32_t callDepth = 0;         /* platform calls that this fiber is inside of */
  const void *callSite = nullptr; /* where the outermost of them was called from */

  const char *stackTop() const { return stackTop_; }
  const char *stackBottom() const { return stackBottom_; }

  /* "waits for spinlock KARSTResolverCache, held by caller", "can run", ... */
  std::string describe() const;

 private:
  friend class Scheduler;

  uint32_t id_ = 0;
  const std::string *name_ = nullptr; /* interned */
  uint64_t nameHash_ = 0;
  bool ready_ = true;     /* blocked on nothing */
  bool heldBack_ = false; /* the driver does not let it run */
  bool ended_ = false;
  bool timedOut_ = false;
  Wait wait_{};
  WaitQueue *queue_ = nullptr;
  Fiber *nextInQueue_ = nullptr;

  std::function<void()> body_;
  std::function<void()> onEnd_;
  std::unique_ptr<Stack> stack_; /* null for the driver, which is on its thread's own */
  const char *stackTop_ = nullptr;
  const char *stackBottom_ = nullptr;
  void *context_ = nullptr;
  std::array<void *, 2> exceptionState_{}; /* of the C++ runtime: what is being thrown and caught */
  void *fakeStack_ = nullptr;              /* of the address sanitizer */
  void *threadSanitizerFiber_ = nullptr;
};

}  // namespace sim
