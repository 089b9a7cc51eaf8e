/* Taking and giving back spinlocks, the rules that are checked on the way, and the question whether
 * a holder is due to give way. Only atomics and the calling thread's own list; no lock.
 */
#include "host/threads/spinlock.h"

#include <immintrin.h>
#include <sched.h>
#include <unistd.h>

#include "host/kernel/panic.h"
#include "host/threads/thread_name.h"
#include "platform/tolm.h"

namespace host {

[[gnu::tls_model("initial-exec"),
  gnu::visibility("hidden")]] constinit thread_local HeldLocks heldLocks{};

namespace {

/* A holder that runs on another processor is usually done within a few hundred cycles; one that
 * lost its processor needs ours. */
constexpr int kSpinsBeforeYield = 100;

/* Long enough for a waiter that runs to see that the lock is free and to take it. */
constexpr int kSpinsForOthers = 64;

std::atomic<uint64_t> lockSliceMicroseconds{2'000};

uint64_t microsecondsNow() {
  return zel_TimerTCToNS(zel_GetTimerCycles()) / 1'000;
}

bool holds(const HeldLocks &mine, const Spinlock &wanted) {
  const Spinlock *lock = mine.last;
  while (lock != nullptr && lock != &wanted) lock = lock->outer;
  return lock != nullptr;
}

[[noreturn, gnu::cold, gnu::noinline]] void panicOnOrder(const Spinlock &lock) {
  const HeldLocks &mine = heldLocks;
  if (holds(mine, lock)) {
    panic("spinlock \"%s\" (rank %u) is taken again by the thread that holds \"%s\" already",
          lock.name.text, lock.rank, lock.name.text);
  }
  panic("spinlock \"%s\" (rank %u) is taken while \"%s\" (rank %u) is held: ranks must rise",
        lock.name.text, lock.rank, mine.last->name.text, mine.last->rank);
}

bool tryTake(Spinlock &lock, uint32_t thread) {
  uint32_t nobody = 0;
  return lock.holder.compare_exchange_strong(nobody, thread, std::memory_order_acquire,
                                             std::memory_order_relaxed);
}

/* What its new holder notes about a lock. It is mostly taken under the same one, or none; a store beside
 * `holder`, which the next exchange would wait for, costs more than the question. */
void noteTaken(Spinlock &lock, HeldLocks &mine, Spinlock *outer) {
  if (lock.outer != outer) lock.outer = outer;
  std::atomic_signal_fence(std::memory_order_release); /* a report walks the list */
  mine.last = &lock;
}

/* A thread that takes a lock over and over has it in its processor's cache, and would always be
 * faster than one that waits elsewhere. So who comes while somebody spins for the lock gives them the
 * time to take it; but not for long, because they may have lost their processor. */
void letOthersGoFirst(Spinlock &lock) {
  for (int spins = 0; lock.wanted.load(std::memory_order_relaxed); ++spins) {
    if (lock.holder.load(std::memory_order_relaxed) != 0) return;
    if (spins == kSpinsForOthers) return lock.wanted.store(false, std::memory_order_relaxed);
    _mm_pause();
  }
}

void spinFor(Spinlock &lock, uint32_t thread) {
  for (int spins = 1;; ++spins) {
    if (lock.holder.load(std::memory_order_relaxed) == 0 && tryTake(lock, thread)) return;
    if (spins % kSpinsBeforeYield == 0) {
      sched_yield();
      continue;
    }
    if (!lock.wanted.load(std::memory_order_relaxed)) {
      lock.wanted.store(true, std::memory_order_relaxed);
    }
    _mm_pause();
  }
}

/* Locking and unlocking are leaf functions as long as nothing is unusual; what is goes on in
 * functions like this one, which finish the job themselves. This one: a lock that is held or that
 * others wait for, or a thread's first. */
[[gnu::cold, gnu::noinline]] void waitAndTake(Spinlock &lock) {
  HeldLocks &mine = heldLocks;
  if (mine.thread == 0) mine.thread = static_cast<uint32_t>(gettid());
  mine.waitingFor = &lock;
  letOthersGoFirst(lock);
  if (!tryTake(lock, mine.thread)) {
    lock.waiters.fetch_add(1, std::memory_order_relaxed);
    spinFor(lock, mine.thread);
    lock.waiters.fetch_sub(1, std::memory_order_relaxed);
    lock.wanted.store(false, std::memory_order_relaxed); /* who still spins for it says so again */
  }
  mine.waitingFor = nullptr;
  noteTaken(lock, mine, mine.last);
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

/* Gives back a lock whose hold was timed, or that is not the last one taken, if it was taken at
 * all. */
[[gnu::cold, gnu::noinline]] void giveBackUnusual(Spinlock &lock) {
  HeldLocks &mine = heldLocks;
  if (!holds(mine, lock)) panicOnForeignUnlock(lock);
  Spinlock **place = &mine.last;
  while (*place != &lock) place = &(*place)->outer;
  *place = lock.outer;
  lock.timed = false;
  giveBack(lock);
}

/* Has the calling thread, which holds the lock, been waited for longer than the slice? */
bool isOverdue(Spinlock &lock) {
  if (lock.waiters.load(std::memory_order_relaxed) == 0) return false;
  const uint64_t now = microsecondsNow();
  if (!lock.timed) lock.waitedSince = now;
  lock.timed = true;
  return now - lock.waitedSince > lockSliceMicroseconds.load(std::memory_order_relaxed);
}

}  // namespace

void requireNoSpinlock(const char *doing, const char *what) {
  if (heldLocks.last == nullptr) return;
  panic("%s %s (%s) while it holds spinlock \"%s\"", describeThread(gettid()).c_str(), doing, what,
        heldLocks.last->name.text);
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
  Spinlock *const outer = mine.last;
  if (outer != nullptr && lock.rank <= outer->rank) panicOnOrder(lock);
  if (lock.wanted.load(std::memory_order_relaxed) || mine.thread == 0 ||
      !tryTake(lock, mine.thread)) {
    waitAndTake(lock);
  } else {
    noteTaken(lock, mine, outer);
  }
}

extern "C" void zel_SpinlockUnlock(zel_SpinlockHandle handle) {
  Spinlock &lock = lockOf(handle);
  HeldLocks &mine = heldLocks;
  if (mine.last != &lock || lock.timed) {
    giveBackUnusual(lock);
  } else {
    mine.last = lock.outer;
    giveBack(lock);
  }
}

/* A hold is timed from the first question at which somebody waits, because taking a free lock reads
 * no clock. So an answer may come late, by up to a slice, and is never wrong. */
extern "C" bool tolmapi_PreemptionIsPending(void) {
  HeldLocks &mine = heldLocks;
  if (mine.preemptionAnswered) {
    mine.preemptionAnswered = false;
    return false;
  }
  for (Spinlock *lock = mine.last; lock != nullptr; lock = lock->outer) {
    if (isOverdue(*lock)) {
      mine.preemptionAnswered = true;
      return true;
    }
  }
  return false;
}
