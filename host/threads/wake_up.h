/* What a thread sleeps on, with a mutex of its owner's. Like std::condition_variable, but the mutex is
 * taken again as any other is: the C library's condition leaves it marked as waited for, and each wake-up
 * then costs a second system call when the mutex is given back.
 */
#pragma once

#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <ctime>
#include <mutex>

namespace host {

class WakeUp {
 public:
  /* Sleeps until a wake-up that is newer than the call, or for `most`; may return without cause. What
   * is waited for changes under the lock, and its change is told afterwards. */
  void wait(std::unique_lock<std::mutex> &lock) { sleep(lock, nullptr); }
  void wait(std::unique_lock<std::mutex> &lock, std::chrono::nanoseconds most) {
    const auto whole = std::chrono::duration_cast<std::chrono::seconds>(most);
    const timespec time{whole.count(), (most - whole).count()};
    sleep(lock, &time);
  }

  /* With the lock held or after it was given back, which is better: who wakes needs it. */
  void one() { wake(1); }
  void all() { wake(INT_MAX); }

 private:
  void sleep(std::unique_lock<std::mutex> &lock, const timespec *most) {
    sleepers_.fetch_add(1, std::memory_order_relaxed);
    const uint32_t seen = turn_.load(std::memory_order_relaxed);
    lock.unlock();
    syscall(SYS_futex, &turn_, FUTEX_WAIT_PRIVATE, seen, most);
    lock.lock();
    sleepers_.fetch_sub(1, std::memory_order_relaxed);
  }

  /* The lock orders this behind the look of whoever sleeps now: its sleep is counted, and its turn is
   * the old one, so that it does not fall asleep any more if it has not yet. */
  void wake(int most) {
    turn_.fetch_add(1, std::memory_order_relaxed);
    if (sleepers_.load(std::memory_order_relaxed) == 0) return;
    syscall(SYS_futex, &turn_, FUTEX_WAKE_PRIVATE, most);
  }

  std::atomic<uint32_t> turn_{0}, sleepers_{0};
};

/* Makes what the calling thread has put off (worlds.h); before it blocks. */
void makeWakeUps();

}  // namespace host
