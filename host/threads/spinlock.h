/* Spinlocks and what each thread knows about those that it holds.
 *
 * A lock guards its own fields by being held, save for the atomic ones; its place in its domain is
 * guarded by the mutex of lock_domain.cpp. What a thread holds is the thread's own business and
 * needs no lock.
 */
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/zel.h"

namespace host {

struct LockDomain;

/* A lock lives in its owner's heap and its handle is its address. What taking and giving back a free
 * lock touches comes first and is 16 bytes, as heap blocks are aligned: never two cache lines. */
struct Spinlock {
  std::atomic<uint32_t> holder{0}; /* thread that holds it; 0: free */
  uint16_t rank = 0;
  std::atomic<bool> wanted{false}; /* somebody spins for it: who comes now lets them go first */
  bool timed = false;              /* waitedSince is set; the holder's own, as are the next two */
  Spinlock *outer = nullptr;       /* the lock that its holder took before it */
  uint64_t waitedSince = 0;        /* us; when the holder first learned that somebody waits */
  std::atomic<uint32_t> waiters{0};
  zel_Name name{};
  zel_HeapID heap = ZEL_NO_HEAP;
  LockDomain *domain = nullptr;
  Spinlock *previous = nullptr; /* among the locks of the domain */
  Spinlock *next = nullptr;
};

inline Spinlock &lockOf(zel_SpinlockHandle handle) {
  return *reinterpret_cast<Spinlock *>(handle);
}

/* What the calling thread holds. Ranks fall along the list, so that its first lock alone decides
 * whether another one may be taken. */
struct HeldLocks {
  uint32_t thread;            /* the system's number of this thread; 0 until its first lock */
  bool preemptionAnswered;    /* the last answer to "is preemption pending?" was yes */
  Spinlock *last;             /* of those held, the one taken last; the others by `outer` */
  const Spinlock *waitingFor; /* the lock that the thread spins for at the moment */
};
/* Reached without a call, so that taking a free lock needs no stack, and, being the program's own,
 * without a look at where it lies. */
[[gnu::tls_model("initial-exec"),
  gnu::visibility("hidden")]] extern constinit thread_local HeldLocks heldLocks;

/* Panics, naming the lock, when the calling thread holds one: `doing` and `what` say what it must
 * not do meanwhile ("waits", "for deliveries"). */
void requireNoSpinlock(const char *doing, const char *what);

/* Panics unless nobody holds the lock or waits for it; `doing` says what is about to happen to it.
 */
void requireUnused(const Spinlock &lock, const char *doing);

/* How long a lock may be held, with a waiter, before its holder is asked to give way. */
void setLockSlice(std::chrono::microseconds slice);

/* The locks and domains that exist, a line each. */
std::vector<std::string> aliveLocks();

}  // namespace host
