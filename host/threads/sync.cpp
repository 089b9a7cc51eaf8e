/* The host's own mutexes, conditions and threads, over those of the system. The mutex of a wait is
 * its caller's.
 */
#include "host/threads/sync.h"

#include <thread>

#include "host/threads/spinlock.h"
#include "host/threads/thread_name.h"
#include "host/threads/wake_up.h"

namespace host {

struct Mutex::Impl {
  std::mutex mutex;
};

Mutex::Mutex() : impl_(std::make_unique<Impl>()) {}
Mutex::~Mutex() = default;
void Mutex::lock() {
  impl_->mutex.lock();
}
void Mutex::unlock() {
  impl_->mutex.unlock();
}

struct Condition::Impl {
  WakeUp wakeUp;
};

Condition::Condition() : impl_(std::make_unique<Impl>()) {}
Condition::~Condition() = default;
void Condition::notifyOne() {
  impl_->wakeUp.one();
}
void Condition::notifyAll() {
  impl_->wakeUp.all();
}

void Condition::wait(std::unique_lock<Mutex> &lock, WaitReason reason) {
  requireNoSpinlock("waits", reason.text);
  makeWakeUps();
  std::unique_lock<std::mutex> held(lock.mutex()->impl_->mutex, std::adopt_lock);
  impl_->wakeUp.wait(held);
  held.release(); /* the caller's lock goes on owning the mutex */
}

struct Thread::Impl {
  std::thread thread;
};

Thread::Thread(std::string name, std::function<void()> body) : impl_(std::make_unique<Impl>()) {
  impl_->thread = std::thread([name = std::move(name), body = std::move(body)] {
    nameThisThread(name);
    body();
    requireNoSpinlock("ends", name.c_str());
  });
}

Thread::~Thread() {
  impl_->thread.join();
}

const void *Thread::current() {
  static thread_local char self;
  return &self;
}

}  // namespace host
