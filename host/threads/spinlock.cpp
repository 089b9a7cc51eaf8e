/* Taking and giving back spinlocks, the rules that are checked on the way, and the question whether
 * a holder is due to give way. Only atomics and the calling thread's own list; no lock.
 */
#include "host/threads/spinlock.h"

#include <immintrin.h>
#include <sched.h>
#include <unistd.h>

#include <algorithm>

#include "host/kernel/panic.h"
#include "host/threads/thread_name.h"
#include "platform/tolm.h"

namespace host {

[[gnu::tls_model("initial-exec")]] constinit thread_local HeldLocks heldLocks{};

namespace {

/* A holder that runs on another processor is usually done within a few hundred cycles; one that
 * lost its processor needs ours. */
constexpr int kSpinsBeforeYield = 100;

constexpr int kMarkTimeBits = 48;
constexpr uint64_t kMarkTimeMask = (uint64_t{1} << kMarkTimeBits) - 1;

std::atomic<uint64_t> lockSliceMicroseconds{2'000};

uint64_t microsecondsNow() {
  return zel_TimerTCToNS(zel_GetTimerCycles()) / 1'000;
}

[[noreturn, gnu::cold, gnu::noinline]] void panicOnOrder(const Spinlock &lock) {
  const HeldLocks &mine = heldLocks;
  const auto end = mine.locks + mine.count;
  if (std::find(mine.locks, end, &lock) != end) {
    panic("spinlock \"%s\" (rank %u) is taken again by the thread that holds \"%s\" already",
          lock.name.text, lock.rank, lock.name.text);
  }
  const Spinlock &last = *mine.locks[mine.count - 1];
  if (mine.count == kMostLocksHeld) {
    panic("spinlock \"%s\" is taken by a thread that holds %zu locks already, the last \"%s\"",
          lock.name.text, kMostLocksHeld, last.name.text);
  }
  panic("spinlock \"%s\" (rank %u) is taken while \"%s\" (rank %u) is held: ranks must rise",
        lock.name.text, lock.rank, last.name.text, last.rank);
}

/* Tells the holder since when, at the latest, it has held the lock. The number of the hold is read
 * before the clock and goes with the time: a mark that comes too late, when the lock has changed
 * hands, names a hold that is over and counts for nobody. */
void markWait(Spinlock &lock) {
  const uint64_t hold = lock.hold.load(std::memory_order_relaxed);
  if (lock.waitMark.load(std::memory_order_relaxed) >> kMarkTimeBits == hold) return;
  const uint64_t mark = (hold << kMarkTimeBits) | (microsecondsNow() & kMarkTimeMask);
  lock.waitMark.store(mark, std::memory_order_relaxed);
}

bool tryTake(Spinlock &lock, uint32_t thread) {
  uint32_t nobody = 0;
  return lock.holder.compare_exchange_strong(nobody, thread, std::memory_order_acquire,
                                             std::memory_order_relaxed);
}

/* What its new holder notes about a lock. */
void noteTaken(Spinlock &lock, HeldLocks &mine) {
  const auto hold = static_cast<uint16_t>(lock.hold.load(std::memory_order_relaxed) + 1);
  lock.hold.store(hold, std::memory_order_relaxed);
  mine.locks[mine.count++] = &lock;
}

/* Locking and unlocking are leaf functions as long as nothing is unusual; what is goes on in
 * functions like this one, which finish the job themselves. This one: a lock that is held, or a
 * thread's first. */
[[gnu::cold, gnu::noinline]] void waitAndTake(Spinlock &lock) {
  HeldLocks &mine = heldLocks;
  if (mine.thread == 0) mine.thread = static_cast<uint32_t>(gettid());
  mine.waitingFor = &lock;
  lock.waiters.fetch_add(1, std::memory_order_relaxed);
  for (int spins = 0;; ++spins) {
    if (lock.holder.load(std::memory_order_relaxed) == 0 && tryTake(lock, mine.thread)) break;
    if (spins < kSpinsBeforeYield) {
      _mm_pause();
      continue;
    }
    markWait(lock);
    sched_yield();
  }
  lock.waiters.fetch_sub(1, std::memory_order_relaxed);
  mine.waitingFor = nullptr;
  noteTaken(lock, mine);
}

/* The last touch of a lock: whoever sees it free may release its memory at once. */
void giveBack(Spinlock &lock) {
  lock.holder.store(0, std::memory_order_release);
}

[[noreturn]] void panicOnForeignUnlock(const Spinlock &lock) {
  const uint32_t holder = lock.holder.load(std::memory_order_relaxed);
  const std::string self = describeThread(gettid());
  if (holder == 0) {
    panic("spinlock \"%s\" is unlocked by %s while nobody holds it", lock.name.text, self.c_str());
  }
  panic("spinlock \"%s\" is unlocked by %s but held by %s", lock.name.text, self.c_str(),
        describeThread(static_cast<pid_t>(holder)).c_str());
}

/* Gives back a lock that is not the last one taken, if it was taken at all. */
[[gnu::cold, gnu::noinline]] void giveBackOutOfOrder(Spinlock &lock) {
  HeldLocks &mine = heldLocks;
  const auto end = mine.locks + mine.count;
  const auto found = std::find(mine.locks, end, &lock);
  if (found == end) panicOnForeignUnlock(lock);
  std::copy(found + 1, end, found); /* ranks go on rising */
  --mine.count;
  giveBack(lock);
}

/* Has the calling thread, which holds the lock, been waited for longer than the slice? */
bool isOverdue(const Spinlock &lock) {
  if (lock.waiters.load(std::memory_order_relaxed) == 0) return false;
  const uint64_t mark = lock.waitMark.load(std::memory_order_relaxed);
  if (mark >> kMarkTimeBits != lock.hold.load(std::memory_order_relaxed)) return false;
  const uint64_t held = (microsecondsNow() - mark) & kMarkTimeMask;
  return held > lockSliceMicroseconds.load(std::memory_order_relaxed);
}

}  // namespace

void requireNoSpinlock(const char *doing, const char *what) {
  if (heldLocks.count == 0) return;
  const Spinlock &last = *heldLocks.locks[heldLocks.count - 1];
  panic("%s %s (%s) while it holds spinlock \"%s\"", describeThread(gettid()).c_str(), doing, what,
        last.name.text);
}

void requireUnused(const Spinlock &lock, const char *doing) {
  const uint32_t holder = lock.holder.load(std::memory_order_acquire);
  if (holder != 0) {
    panic("spinlock \"%s\" is %s while %s holds it", lock.name.text, doing,
          describeThread(static_cast<pid_t>(holder)).c_str());
  }
  if (lock.waiters.load(std::memory_order_relaxed) != 0) {
    panic("spinlock \"%s\" is %s while somebody waits for it", lock.name.text, doing);
  }
}

void setLockSlice(std::chrono::microseconds slice) {
  lockSliceMicroseconds.store(static_cast<uint64_t>(slice.count()), std::memory_order_relaxed);
}

}  // namespace host

using namespace host;

extern "C" void zel_SpinlockLock(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  HeldLocks &mine = heldLocks;
  const uint32_t count = mine.count;
  if (count != 0 && (lock.rank <= mine.locks[count - 1]->rank || count == kMostLocksHeld)) {
    panicOnOrder(lock);
  }
  if (mine.thread == 0 || !tryTake(lock, mine.thread)) {
    waitAndTake(lock);
  } else {
    noteTaken(lock, mine);
  }
}

extern "C" void zel_SpinlockUnlock(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  HeldLocks &mine = heldLocks;
  const uint32_t count = mine.count;
  if (count == 0 || mine.locks[count - 1] != &lock) {
    giveBackOutOfOrder(lock);
  } else {
    mine.count = count - 1;
    giveBack(lock);
  }
}

/* A hold is timed from the moment when its first waiter gave up spinning, because taking a free
 * lock reads no clock. So an answer may come up to a slice late, and is never wrong. */
extern "C" bool tolmapi_PreemptionIsPending(void) {
  HeldLocks &mine = heldLocks;
  if (mine.preemptionAnswered) {
    mine.preemptionAnswered = false;
    return false;
  }
  for (uint32_t i = 0; i < mine.count; ++i) {
    if (isOverdue(*mine.locks[i])) {
      mine.preemptionAnswered = true;
      return true;
    }
  }
  return false;
}
