/* What callbacks leave for the thread that prints: callbacks run under a spinlock and may neither
 * read locators nor wait for a terminal. The lock guards the list and is held for moments only.
 */
#pragma once

#include <chrono>
#include <deque>
#include <mutex>
#include <optional>

#include "host/sources/waiting.h"

namespace cli {

struct Watched; /* a target under watch */

using Moment = std::chrono::system_clock::time_point;

struct Note {
  Watched *watched;
  Moment time;
};

class Notes {
 public:
  Notes(); /* throws std::system_error */

  /* Any thread, under a spinlock too. */
  void addCall(Watched *watched);
  void addChange(); /* the directory was told something */

  /* The printing thread's. */
  std::optional<Note> takeCall();
  bool takeChange();
  void forgetCalls(const Watched *watched);
  void forgetAllCalls();

  /* Readable from each add until it was seen. */
  int descriptor() const { return signal_.get(); }
  void seen();

 private:
  void wake();

  std::mutex mutex_;
  std::deque<Note> calls_; /* mutex_ */
  bool change_ = false;    /* mutex_ */
  host::Descriptor signal_;
};

}  // namespace cli
