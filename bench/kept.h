/* The bytes that a read-out copies, kept in the ways in which programs keep what many threads read and
 * one changes at times.
 *
 * A Kept has read(Locators &), write(const Locators &), and Visit: an object that a thread has for as
 * long as it reads. Any thread may write. */
#pragma once

#include <pthread.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <shared_mutex>

#define _LGPL_SOURCE /* marks inlined, not called */
#include <urcu/urcu-memb.h>
#include <urcu/urcu-qsbr.h>

#include "karst_resolver/karst_resolver.h"

namespace bench {

using Locators = KARSTResolverNodeLocators;

/* What a thread is that nobody needs to know of. */
struct NoVisit {};

/* ---- Behind a lock --------------------------------------------------------------------------- */

template <typename Mutex, typename ReadersLock = std::lock_guard<Mutex>>
class Behind {
 public:
  using Visit = NoVisit;
  void read(Locators &into) {
    const ReadersLock lock(mutex_);
    into = kept_;
  }
  void write(const Locators &from) {
    const std::lock_guard lock(mutex_);
    kept_ = from;
  }

 private:
  alignas(64) Mutex mutex_;
  Locators kept_{};
};

struct NoLock {
  void lock() { asm volatile("" ::: "memory"); }
  void unlock() { asm volatile("" ::: "memory"); }
};

/* The least that a lock can be: one exchange, when nobody has it, and one store. */
class OneExchange {
 public:
  void lock() {
    while (taken_.exchange(1, std::memory_order_acquire) != 0) {
    }
  }
  void unlock() { taken_.store(0, std::memory_order_release); }

 private:
  std::atomic<uint32_t> taken_{0};
};

/* The same as modules reach a platform's lock: by two calls. */
class OneExchangeCalled {
 public:
  __attribute__((noinline)) void lock() { lock_.lock(); }
  __attribute__((noinline)) void unlock() { lock_.unlock(); }

 private:
  OneExchange lock_;
};

class PthreadSpinlock {
 public:
  PthreadSpinlock() { pthread_spin_init(&lock_, PTHREAD_PROCESS_PRIVATE); }
  ~PthreadSpinlock() { pthread_spin_destroy(&lock_); }
  PthreadSpinlock(const PthreadSpinlock &) = delete;
  PthreadSpinlock &operator=(const PthreadSpinlock &) = delete;
  void lock() { pthread_spin_lock(&lock_); }
  void unlock() { pthread_spin_unlock(&lock_); }

 private:
  pthread_spinlock_t lock_;
};

using BehindMutex = Behind<std::mutex>;
using BehindSharedMutex = Behind<std::shared_mutex, std::shared_lock<std::shared_mutex>>;
using BehindSpinlock = Behind<PthreadSpinlock>;

/* ---- An immutable copy, replaced as a whole --------------------------------------------------- */

/* A reader's mark is a store; who writes asks the system for a barrier on every processor. */
struct Memb {
  Memb() { urcu_memb_register_thread(); }
  ~Memb() { urcu_memb_unregister_thread(); }
  static void enter() { urcu_memb_read_lock(); }
  static void leave() { urcu_memb_read_unlock(); }
  static void wait() { urcu_memb_synchronize_rcu(); }
};

/* A reader has no mark, but says after each reading that it is between two. */
struct Qsbr {
  Qsbr() { urcu_qsbr_register_thread(); }
  ~Qsbr() { urcu_qsbr_unregister_thread(); }
  static void enter() { urcu_qsbr_read_lock(); }
  static void leave() {
    urcu_qsbr_read_unlock();
    urcu_qsbr_quiescent_state();
  }
  static void wait() { urcu_qsbr_synchronize_rcu(); }
};

template <typename Rcu>
class Published {
 public:
  using Visit = Rcu;
  Published() = default;
  ~Published() { delete kept_.load(); }
  Published(const Published &) = delete;
  Published &operator=(const Published &) = delete;
  void read(Locators &into) {
    Rcu::enter();
    into = *kept_.load(std::memory_order_acquire);
    Rcu::leave();
  }
  void write(const Locators &from) {
    const Locators *const old = kept_.exchange(new Locators(from));
    Rcu::wait();
    delete old;
  }

 private:
  alignas(64) std::atomic<const Locators *> kept_{new Locators{}};
};

class BySharedPtr {
 public:
  using Visit = NoVisit;
  void read(Locators &into) { into = *kept_.load(); }
  void write(const Locators &from) { kept_.store(std::make_shared<const Locators>(from)); }

 private:
  alignas(64) std::atomic<std::shared_ptr<const Locators>> kept_{
      std::make_shared<const Locators>()};
};

}  // namespace bench
