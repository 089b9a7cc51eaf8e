/* Fibers over Boost's machine contexts. Who may run is one list, in the order of becoming able to;
 * every change of it passes through addRunnable and removeRunnable. One OS thread, no lock.
 */
#include "sim/scheduler.h"

#include <cxxabi.h>
#include <pthread.h>

#include <algorithm>
#include <boost/context/detail/fcontext.hpp>
#include <boost/context/protected_fixedsize_stack.hpp>
#include <cstring>
#include <unordered_set>
#include <utility>

#include "host/kernel/panic.h"
#include "sim/access/access.h"
#include "sim/locks.h"
#include "sim/sanitizers.h"

namespace sim {

namespace context = boost::context::detail;

namespace {

/* The one text of a name, for as long as the program runs: a history is read after its machine. */
const std::string *intern(const std::string &name) {
  static std::unordered_set<std::string> names;
  return &*names.insert(name).first;
}

}  // namespace

/* ---- Stacks ---------------------------------------------------------------------------------- */

Stack::Stack() {
  boost::context::protected_fixedsize_stack allocator(sanitizers::stackSize);
  const boost::context::stack_context memory = allocator.allocate();
  top_ = static_cast<char *>(memory.sp);
  bottom_ = top_ - memory.size + boost::context::stack_traits::page_size();
  sanitizers::stackMade(bottom_, size());
}

Stack::~Stack() {
  sanitizers::stackGone(bottom_, size());
  boost::context::stack_context memory;
  memory.sp = top_;
  memory.size = size() + boost::context::stack_traits::page_size();
  boost::context::protected_fixedsize_stack(sanitizers::stackSize).deallocate(memory);
}

std::unique_ptr<Stack> Stack::take() {
  if (spare_.empty()) return std::make_unique<Stack>();
  std::unique_ptr<Stack> stack = std::move(spare_.back());
  spare_.pop_back();
  return stack;
}

void Stack::giveBack(std::unique_ptr<Stack> stack) {
  sanitizers::stackCleaned(stack->bottom_, stack->size());
  spare_.push_back(std::move(stack));
}

/* ---- Reports --------------------------------------------------------------------------------- */

std::string Fiber::describe() const {
  if (ended_) return "has ended";
  std::string text = ready_ ? "can run" : "waits for ";
  if (!ready_) {
    text += wait_.what;
    if (wait_.object) text += std::string(" ") + wait_.object;
    if (wait_.holder) text += ", held by " + wait_.holder->name();
    if (wait_.until != never) text += ", until " + std::to_string(wait_.until) + " ns";
    if (wait_.idle) text += " (idle)";
  }
  if (heldBack_) text += " (held back)";
  return text;
}

void Scheduler::reportDeadlock(const char *headline) const {
  std::string text = headline;
  if (!driver_.ready_) text += "\n  " + driver_.name() + ": " + driver_.describe();
  for (const auto &fiber : fibers_) text += "\n  " + fiber->name() + ": " + fiber->describe();
  host::panic("%s", text.c_str());
}

/* ---- Making and ending fibers ---------------------------------------------------------------- */

namespace {

struct StackRange {
  char *bottom;
  char *top;
};

/* Of the one OS thread; asked for once, since the answer takes long. */
const StackRange &ownStack() {
  static const StackRange range = [] {
    pthread_attr_t attributes;
    void *bottom = nullptr;
    size_t size = 0;
    if (pthread_getattr_np(pthread_self(), &attributes) != 0 ||
        pthread_attr_getstack(&attributes, &bottom, &size) != 0)
      host::panic("the stack of the simulator's thread is not known");
    pthread_attr_destroy(&attributes);
    return StackRange{static_cast<char *>(bottom), static_cast<char *>(bottom) + size};
  }();
  return range;
}

}  // namespace

Scheduler::Scheduler(std::unique_ptr<Strategy> strategy)
    : strategy_(std::move(strategy)), exceptionState_(abi::__cxa_get_globals()) {
  if (instance_) host::panic("a second simulation while the first one is still there");
  instance_ = this;
  driver_.name_ = intern("driver");
  driver_.threadSanitizerFiber_ = sanitizers::threadOfCaller();
  const StackRange &own = ownStack();
  driver_.stackBottom_ = own.bottom;
  driver_.stackTop_ = own.top;
}

Scheduler::~Scheduler() {
  instance_ = nullptr;
  for (const auto &fiber : fibers_) sanitizers::endThread(fiber->threadSanitizerFiber_);
}

/* Where every fiber begins. */
struct FiberEntry {
  static void begin(context::transfer_t transfer) {
    Scheduler &scheduler = *Scheduler::instance_;
    scheduler.landed(*static_cast<Fiber *>(transfer.data), transfer.fctx);
    scheduler.runBody();
  }
};

Fiber &Scheduler::spawn(const std::string &name, std::function<void()> body,
                        std::function<void()> onEnd) {
  auto fiber = std::make_unique<Fiber>();
  fiber->id_ = ++lastId_;
  fiber->name_ = intern(name);
  fiber->nameHash_ = std::hash<std::string>()(name);
  fiber->body_ = std::move(body);
  fiber->onEnd_ = std::move(onEnd);
  fiber->stack_ = Stack::take();
  fiber->stackTop_ = static_cast<char *>(fiber->stack_->top());
  fiber->stackBottom_ = static_cast<char *>(fiber->stack_->bottom());
  fiber->context_ =
      context::make_fcontext(fiber->stack_->top(), fiber->stack_->size(), &FiberEntry::begin);
  fiber->threadSanitizerFiber_ = sanitizers::makeThread(name.c_str());
  fiber->heldBack_ = heldByName(*fiber);
  access::begins(*fiber);
  Fiber &made = *fiber;
  fibers_.push_back(std::move(fiber));
  addRunnable(made);
  return made;
}

void Scheduler::runBody() {
  Fiber &fiber = *current_;
  try {
    fiber.body_();
  } catch (...) {
    escaped_ = std::current_exception();
  }
  fiber.body_ = nullptr;
  requireNoSpinlock(fiber, "ends");
  if (fiber.onEnd_) fiber.onEnd_();
  fiber.onEnd_ = nullptr;
  fiber.ended_ = true;
  fiber.ready_ = false;
  removeRunnable(fiber);
  last_ = nullptr;
  switchTo(driver_);
  host::panic("%s goes on after its end", fiber.name().c_str());
}

void Scheduler::reap(Fiber &fiber) {
  sanitizers::endThread(fiber.threadSanitizerFiber_);
  access::ends(fiber);
  Stack::giveBack(std::move(fiber.stack_));
  const auto place = std::find_if(fibers_.begin(), fibers_.end(),
                                  [&](const auto &other) { return other.get() == &fiber; });
  fibers_.erase(place);
}

/* ---- Switching ------------------------------------------------------------------------------- */

void Scheduler::switchTo(Fiber &next) {
  Fiber &previous = *current_;
  current_ = &next;
  /* What is being thrown and caught belongs to the fiber, but the C++ runtime keeps it by thread.
   */
  std::memcpy(previous.exceptionState_.data(), exceptionState_, sizeof previous.exceptionState_);
  std::memcpy(exceptionState_, next.exceptionState_.data(), sizeof next.exceptionState_);

  sanitizers::beforeSwitch(previous.ended_ ? nullptr : &previous.fakeStack_, next.stackBottom_,
                           static_cast<size_t>(next.stackTop_ - next.stackBottom_));
  sanitizers::switchThread(next.threadSanitizerFiber_);
  const context::transfer_t transfer = context::jump_fcontext(next.context_, &previous);
  landed(*static_cast<Fiber *>(transfer.data), transfer.fctx);
}

void Scheduler::landed(Fiber &previous, void *context) {
  sanitizers::afterSwitch(current_->fakeStack_);
  previous.context_ = context;
  if (previous.ended_) reap(previous);
}

Fiber *Scheduler::choose() {
  if (runnable_.empty()) return nullptr;
  Fiber &next = strategy_->next(runnable_, last_);
  mix(next.id());
  return &next;
}

void Scheduler::leave() {
  Fiber &fiber = *current_;
  last_ = fiber.ready_ && !fiber.heldBack_ ? &fiber : nullptr;
  Fiber *next = steps_ >= pause_ ? nullptr : choose();
  if (next != &fiber) switchTo(next ? *next : driver_);
}

/* ---- Who can run ----------------------------------------------------------------------------- */

void Scheduler::addRunnable(Fiber &fiber) {
  if (fiber.ready_ && !fiber.heldBack_ && &fiber != &driver_) runnable_.push_back(&fiber);
}

void Scheduler::removeRunnable(Fiber &fiber) {
  const auto place = std::find(runnable_.begin(), runnable_.end(), &fiber);
  if (place != runnable_.end()) runnable_.erase(place);
  if (last_ == &fiber) last_ = nullptr;
}

void Scheduler::setReady(Fiber &fiber) {
  fiber.ready_ = true;
  addRunnable(fiber);
  if (&fiber == &driver_) pause_ = 0;
}

void Scheduler::enqueue(WaitQueue &queue, Fiber &fiber) {
  fiber.queue_ = &queue;
  fiber.nextInQueue_ = nullptr;
  (queue.last ? queue.last->nextInQueue_ : queue.first) = &fiber;
  queue.last = &fiber;
}

void Scheduler::unqueue(Fiber &fiber) {
  WaitQueue &queue = *fiber.queue_;
  Fiber *before = nullptr;
  for (Fiber *other = queue.first; other != &fiber; other = other->nextInQueue_) before = other;
  (before ? before->nextInQueue_ : queue.first) = fiber.nextInQueue_;
  if (queue.last == &fiber) queue.last = before;
  fiber.queue_ = nullptr;
}

bool Scheduler::block(WaitQueue &queue, const Wait &wait) {
  Fiber &fiber = *current_;
  fiber.wait_ = wait;
  fiber.timedOut_ = false;
  fiber.ready_ = false;
  enqueue(queue, fiber);
  if (!driving()) {
    removeRunnable(fiber);
    ++steps_;
    leave();
    return !fiber.timedOut_;
  }
  while (!fiber.ready_) {
    const Stop stop = drive({.until = &fiber.ready_, .time = wait.until});
    if (stop == Stop::Quiet) reportDeadlock("deadlock: the driver waits in vain");
    if (stop == Stop::Time && !fiber.ready_) {
      unqueue(fiber);
      fiber.timedOut_ = fiber.ready_ = true;
    }
  }
  return !fiber.timedOut_;
}

void Scheduler::sleep(uint64_t nanoseconds) {
  WaitQueue nobodyWakes;
  block(nobodyWakes, {.what = "time to pass", .until = now_ + nanoseconds});
}

void Scheduler::wakeAll(WaitQueue &queue) {
  while (Fiber *fiber = queue.first) {
    unqueue(*fiber);
    setReady(*fiber);
  }
}

void Scheduler::wakeAny(WaitQueue &queue) {
  size_t waiters = 0;
  for (Fiber *fiber = queue.first; fiber; fiber = fiber->nextInQueue_) ++waiters;
  size_t skip = waiters > 1 ? pick(waiters) : 0;
  for (Fiber *fiber = queue.first; fiber; fiber = fiber->nextInQueue_) {
    if (skip-- > 0) continue;
    unqueue(*fiber);
    setReady(*fiber);
    return;
  }
}

size_t Scheduler::pick(size_t count) {
  const size_t choice = strategy_->pick(count);
  mix(choice);
  return choice;
}

/* ---- Holding back ---------------------------------------------------------------------------- */

bool Scheduler::heldByName(const Fiber &fiber) const {
  return std::any_of(heldPrefixes_.begin(), heldPrefixes_.end(),
                     [&](const std::string &prefix) { return fiber.name().starts_with(prefix); });
}

void Scheduler::hold(const std::string &namePrefix) {
  heldPrefixes_.push_back(namePrefix);
  for (const auto &fiber : fibers_) {
    if (fiber->heldBack_ || !heldByName(*fiber)) continue;
    fiber->heldBack_ = true;
    removeRunnable(*fiber);
  }
}

void Scheduler::release(const std::string &namePrefix) {
  std::erase_if(heldPrefixes_,
                [&](const std::string &prefix) { return prefix.starts_with(namePrefix); });
  for (const auto &fiber : fibers_) {
    if (!fiber->heldBack_ || heldByName(*fiber)) continue;
    fiber->heldBack_ = false;
    addRunnable(*fiber);
  }
}

/* ---- Driving --------------------------------------------------------------------------------- */

bool Scheduler::advanceTime(uint64_t limit) {
  uint64_t earliest = never;
  for (const auto &fiber : fibers_)
    if (!fiber->ready_ && !fiber->heldBack_) earliest = std::min(earliest, fiber->wait_.until);
  if (earliest == never || earliest > limit) return false;
  now_ = std::max(now_, earliest);
  mix(now_);
  for (const auto &fiber : fibers_) {
    if (fiber->ready_ || fiber->wait_.until > now_) continue;
    unqueue(*fiber);
    fiber->timedOut_ = true;
    setReady(*fiber);
  }
  return true;
}

/* A fiber that is held back may end what others wait for, once it is released; so may the driver.
 * Sleepers are asked about before. */
bool Scheduler::stuck() const {
  bool somebodyWaits = false;
  for (const auto &fiber : fibers_) {
    const bool sleeps = !fiber->ready_ && fiber->wait_.until != never;
    if (fiber->ready_ || sleeps) return false;
    somebodyWaits |= !fiber->wait_.idle;
  }
  return somebodyWaits;
}

Scheduler::Stop Scheduler::drive(const Limits &limits) {
  if (!driving()) host::panic("%s drives the machine that runs it", current_->name().c_str());
  const auto after = [this](uint64_t steps) {
    return steps > noPause - steps_ ? noPause : steps_ + steps;
  };
  const uint64_t stepEnd = after(limits.steps);
  const uint64_t fatalEnd = after(stepLimit_);
  for (;;) {
    pause_ = std::min(stepEnd, fatalEnd);
    if (limits.until && *limits.until) return Stop::Until;
    if (steps_ >= stepEnd) return Stop::Steps;
    if (steps_ >= fatalEnd) reportDeadlock("no quiescence within the step limit");
    if (Fiber *next = choose()) {
      switchTo(*next);
      if (escaped_) std::rethrow_exception(std::exchange(escaped_, nullptr));
      continue;
    }
    if (advanceTime(limits.time)) continue;
    if (stuck()) reportDeadlock("deadlock: nobody can run");
    if (limits.time == never) return Stop::Quiet;
    now_ = std::max(now_, limits.time);
    return Stop::Time;
  }
}

}  // namespace sim
