/* Who is called by the directory, and the threads that call. One lock, the directory's, guards all
 * of it; it is never held while somebody is called.
 */
#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "host/threads/sync.h"

namespace host {

/* Somebody whom the directory calls: one call at a time, in the order in which they fell due. */
class Recipient {
 public:
  Recipient() = default;
  virtual ~Recipient() = default;
  Recipient(const Recipient &) = delete;
  Recipient &operator=(const Recipient &) = delete;

  /* Both are called with the lock held. */
  virtual bool due() const = 0;
  bool running() const { return caller_ != nullptr; }

 private:
  friend class Delivery;

  /* Makes the next call, without the lock, which is held before and after. Something is due. */
  virtual void serve(std::unique_lock<Mutex> &lock) = 0;

  bool listed_ = false;          /* in the ready list */
  const void *caller_ = nullptr; /* while a call runs: the thread that makes it */
};

/* The delivery threads. A recipient with calls due stands in the ready list; a thread makes one
 * call of it and puts it back at the end, so that none can starve the others. */
class Delivery {
 public:
  /* Starts at least one thread. `onReturn` is called with the lock held after each call. */
  Delivery(Mutex &mutex, unsigned threads, std::function<void()> onReturn);
  ~Delivery() { end(); }
  Delivery(const Delivery &) = delete;
  Delivery &operator=(const Delivery &) = delete;

  /* Returns when every call that is due has been made and the threads have ended. Without the
   * lock. */
  void end();

  /* The functions below are called with the lock held. */

  /* Notes that the recipient has something due; harmless when it has not. Never blocks. A thread
   * makes the call once announce() was called. */
  void schedule(const std::shared_ptr<Recipient> &recipient);

  /* Wakes threads for what was scheduled. Gives the lock up first: a thread that wakes needs it. */
  void announce(std::unique_lock<Mutex> &lock);

  bool idle() const; /* nothing is due and no call runs */

  /* These give the lock up while they wait. The first two must not be called from a callback. */
  void waitUntilIdle(std::unique_lock<Mutex> &lock);
  void waitForCallbacks(std::unique_lock<Mutex> &lock);
  /* Returns when no call of the recipient runs, or at once from inside its own call. */
  void waitUntilReturned(const Recipient &recipient, std::unique_lock<Mutex> &lock);

  uint64_t calls() const { return calls_; }
  bool anyRunning(uint64_t lastCall) const; /* of the calls up to that one */

 private:
  bool list(const std::shared_ptr<Recipient> &recipient);
  void work(size_t worker);

  Mutex &mutex_;
  const std::function<void()> onReturn_;
  Condition due_;      /* the ready list has grown, or the end has come */
  Condition returned_; /* a call has returned */
  Condition idle_;     /* the last one has */
  std::deque<std::shared_ptr<Recipient>> ready_;
  size_t unannounced_ = 0; /* recipients in the ready list that no thread was woken for */
  uint64_t calls_ = 0;
  std::vector<uint64_t> running_; /* by thread: number of the call that it makes, or 0 */
  bool ending_ = false;
  std::vector<std::unique_ptr<Thread>> threads_;
};

}  // namespace host
