/* The delivery threads: the ready list, its service and the waits for its end. Lock: the
 * directory's.
 */
#include "host/directory/delivery.h"

#include <algorithm>
#include <limits>
#include <string>
#include <utility>

namespace host {

Delivery::Delivery(Mutex &mutex, unsigned threads, std::function<void()> onReturn)
    : mutex_(mutex), onReturn_(std::move(onReturn)), running_(std::max(threads, 1u), 0) {
  for (size_t i = 0; i < running_.size(); ++i) {
    threads_.push_back(
        std::make_unique<Thread>("karst-delivery-" + std::to_string(i), [this, i] { work(i); }));
  }
}

void Delivery::end() {
  {
    const std::lock_guard<Mutex> lock(mutex_);
    ending_ = true;
    due_.notifyAll();
  }
  threads_.clear();
}

/* One that is being served is put back by its thread. */
bool Delivery::list(const std::shared_ptr<Recipient> &recipient) {
  if (recipient->listed_ || recipient->running() || !recipient->due()) return false;
  recipient->listed_ = true;
  ready_.push_back(recipient);
  return true;
}

void Delivery::schedule(const std::shared_ptr<Recipient> &recipient) {
  if (list(recipient)) ++unannounced_;
}

void Delivery::announce(std::unique_lock<Mutex> &lock) {
  const size_t recipients = std::exchange(unannounced_, 0);
  lock.unlock();
  if (recipients == 1) due_.notifyOne();
  if (recipients > 1) due_.notifyAll();
}

void Delivery::work(size_t worker) {
  std::unique_lock<Mutex> lock(mutex_);
  for (;;) {
    while (ready_.empty() && !ending_) due_.wait(lock, {"directory delivery", true});
    if (ready_.empty()) return;
    const std::shared_ptr<Recipient> recipient = std::move(ready_.front());
    ready_.pop_front();
    recipient->listed_ = false;
    /* What was due may have been dropped since. */
    if (recipient->due()) {
      running_[worker] = ++calls_;
      recipient->caller_ = Thread::current();
      recipient->serve(lock);
      recipient->caller_ = nullptr;
      running_[worker] = 0;
      list(recipient); /* nobody need be woken: this thread looks again */
      onReturn_();
      if (std::exchange(unannounced_, 0) != 0) due_.notifyAll();
    }
    returned_.notifyAll();
    if (idle()) idle_.notifyAll();
  }
}

bool Delivery::anyRunning(uint64_t lastCall) const {
  return std::any_of(running_.begin(), running_.end(),
                     [=](uint64_t call) { return call != 0 && call <= lastCall; });
}

bool Delivery::idle() const {
  return ready_.empty() && !anyRunning(std::numeric_limits<uint64_t>::max());
}

void Delivery::waitUntilIdle(std::unique_lock<Mutex> &lock) {
  while (!idle()) {
    idle_.wait(lock, {"until the directory has nothing to deliver", false});
  }
}

void Delivery::waitForCallbacks(std::unique_lock<Mutex> &lock) {
  const uint64_t lastCall = calls_;
  while (anyRunning(lastCall)) {
    returned_.wait(lock, {"until the directory's running callbacks have returned", false});
  }
}

void Delivery::waitUntilReturned(const Recipient &recipient, std::unique_lock<Mutex> &lock) {
  if (recipient.caller_ == Thread::current()) return;
  while (recipient.running()) {
    returned_.wait(lock, {"until a callback of the directory has returned", false});
  }
}

}  // namespace host
