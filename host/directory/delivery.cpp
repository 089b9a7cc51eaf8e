/* The delivery threads: the ready list, its service and the waits for its end. Lock: the
 * directory's.
 */
#include "host/directory/delivery.h"

#include <unwind.h>

#include <algorithm>
#include <cstdint>
#include <limits>
#include <string>

namespace host {
namespace {

struct StackWalk {
  uintptr_t frame;
  bool belowFrame;
  bool found;
};

_Unwind_Reason_Code visitFrame(_Unwind_Context *context, void *argument) {
  StackWalk &walk = *static_cast<StackWalk *>(argument);
  const bool below = _Unwind_GetCFA(context) <= walk.frame;
  walk.found = walk.belowFrame && !below;
  walk.belowFrame = below;
  return walk.found ? _URC_NORMAL_STOP : _URC_NO_REASON;
}

/* Whether the caller was called, however indirectly, from the frame. Asked of the stack itself and
 * not of a thread-local variable, because threads of the simulator share those. */
bool calledFrom(const void *frame) {
  StackWalk walk{reinterpret_cast<uintptr_t>(frame), false, false};
  _Unwind_Backtrace(visitFrame, &walk);
  return walk.found;
}

}  // namespace

Delivery::Delivery(Mutex &mutex, unsigned threads)
    : mutex_(mutex), running_(std::max(threads, 1u), 0) {
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

void Delivery::schedule(const std::shared_ptr<Recipient> &recipient) {
  /* One that is being served is put back by its thread. */
  if (recipient->listed_ || recipient->running() || !recipient->due()) return;
  recipient->listed_ = true;
  ready_.push_back(recipient);
  due_.notifyOne();
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
      recipient->stack_ = __builtin_frame_address(0);
      recipient->serve(lock);
      recipient->stack_ = nullptr;
      running_[worker] = 0;
      schedule(recipient);
    }
    returned_.notifyAll();
  }
}

bool Delivery::anyRunning(uint64_t lastCall) const {
  return std::any_of(running_.begin(), running_.end(),
                     [=](uint64_t call) { return call != 0 && call <= lastCall; });
}

void Delivery::waitUntilIdle(std::unique_lock<Mutex> &lock) {
  while (!ready_.empty() || anyRunning(std::numeric_limits<uint64_t>::max())) {
    returned_.wait(lock, {"until the directory has nothing to deliver", false});
  }
}

void Delivery::waitForCallbacks(std::unique_lock<Mutex> &lock) {
  const uint64_t lastCall = calls_;
  while (anyRunning(lastCall)) {
    returned_.wait(lock, {"until the directory's running callbacks have returned", false});
  }
}

void Delivery::waitUntilReturned(const Recipient &recipient, std::unique_lock<Mutex> &lock) {
  if (!recipient.running() || calledFrom(recipient.stack_)) return;
  while (recipient.running()) {
    returned_.wait(lock, {"until a callback of the directory has returned", false});
  }
}

}  // namespace host
