/* The host's mutexes, conditions and threads on fibers. A mutex works without a machine too, as
 * long as nobody has to wait for it. One OS thread, no lock.
 */
#include "host/threads/sync.h"

#include "host/kernel/panic.h"
#include "sim/locks.h"
#include "sim/scheduler.h"

namespace {

sim::Scheduler &scheduler() {
  sim::Scheduler *current = sim::Scheduler::current();
  if (!current) host::panic("a thread or a wait without a simulated machine");
  return *current;
}

}  // namespace

namespace host {

struct Mutex::Impl {
  bool locked = false;
  const sim::Fiber *holder = nullptr; /* null without a machine */
  sim::WaitQueue waiters{};
};

Mutex::Mutex() : impl_(std::make_unique<Impl>()) {}

Mutex::~Mutex() {
  if (impl_->locked || impl_->waiters.first) panic("a mutex ends while it is in use");
}

void Mutex::lock() {
  sim::Scheduler *machine = sim::Scheduler::current();
  const sim::Fiber *self = machine ? &machine->running() : nullptr;
  if (machine) machine->point();
  if (impl_->locked && impl_->holder == self) panic("a mutex is locked again by its holder");
  while (impl_->locked)
    scheduler().block(impl_->waiters, {.what = "a mutex", .holder = impl_->holder});
  impl_->locked = true;
  impl_->holder = self;
}

void Mutex::unlock() {
  sim::Scheduler *machine = sim::Scheduler::current();
  if (!impl_->locked || (machine && impl_->holder != &machine->running()))
    panic("a mutex is unlocked by one that does not hold it");
  impl_->locked = false;
  impl_->holder = nullptr;
  if (machine) machine->wakeAll(impl_->waiters);
}

struct Condition::Impl {
  sim::WaitQueue waiters{};
};

Condition::Condition() : impl_(std::make_unique<Impl>()) {}

Condition::~Condition() {
  if (impl_->waiters.first) panic("a condition ends while somebody waits for it");
}

void Condition::wait(std::unique_lock<Mutex> &lock, WaitReason reason) {
  sim::requireNoSpinlock(scheduler().running(), "waits for", reason.text);
  lock.unlock();
  scheduler().block(impl_->waiters, {.what = reason.text, .idle = reason.idle});
  lock.lock();
}

void Condition::notifyOne() {
  if (impl_->waiters.first) scheduler().wakeAny(impl_->waiters);
}

void Condition::notifyAll() {
  if (impl_->waiters.first) scheduler().wakeAll(impl_->waiters);
}

struct Thread::Impl {
  std::string name;
  bool ended = false;
  sim::WaitQueue joiners{};
};

Thread::Thread(std::string name, std::function<void()> body) : impl_(std::make_unique<Impl>()) {
  impl_->name = std::move(name);
  Impl *impl = impl_.get();
  scheduler().spawn(impl->name, std::move(body), [impl] {
    impl->ended = true;
    scheduler().wakeAll(impl->joiners);
  });
}

Thread::~Thread() {
  sim::requireNoSpinlock(scheduler().running(), "joins", impl_->name.c_str());
  while (!impl_->ended)
    scheduler().block(impl_->joiners, {.what = "the end of", .object = impl_->name.c_str()});
}

const void *Thread::current() {
  return &scheduler().running();
}

}  // namespace host
