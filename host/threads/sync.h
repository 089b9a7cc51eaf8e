/* Threads, mutexes and conditions for the host kernel's own work (delivery, watching).
 *
 * Two rooms implement this header: host/threads over OS threads, and sim over fibers under one
 * seeded scheduler. Whatever may sleep in host/ sleeps here, so that it runs on either unchanged.
 */
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>

namespace host {

/* Why a thread sleeps. An idle sleeper waits for work that may never come (the end of all activity
 * finds it asleep); one that is not idle waits for somebody's progress, and if nobody can run any
 * more that is a deadlock. */
struct WaitReason {
  const char *text;
  bool idle;
};

/* A mutual-exclusion lock; use with std::unique_lock and std::lock_guard. */
class Mutex {
 public:
  Mutex();
  ~Mutex();
  Mutex(const Mutex &) = delete;
  Mutex &operator=(const Mutex &) = delete;
  void lock();
  void unlock();

 private:
  friend class Condition;
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

/* A condition variable. May wake without cause: wait in a loop. */
class Condition {
 public:
  Condition();
  ~Condition();
  Condition(const Condition &) = delete;
  Condition &operator=(const Condition &) = delete;
  void wait(std::unique_lock<Mutex> &lock, WaitReason reason);
  void notifyOne();
  void notifyAll();

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

/* A named thread; the destructor joins. */
class Thread {
 public:
  Thread(std::string name, std::function<void()> body);
  ~Thread();
  Thread(const Thread &) = delete;
  Thread &operator=(const Thread &) = delete;

  /* Stands for the thread that asks, whoever made it, as long as it runs; never null. */
  static const void *current();

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace host
