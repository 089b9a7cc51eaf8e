/* The list between callbacks and the printing thread. */
#include "cli/notes.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cstdint>
#include <utility>

namespace cli {

Notes::Notes() : signal_(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC), "eventfd") {}

void Notes::addCall(Watched *watched) {
  {
    const std::lock_guard lock(mutex_);
    calls_.push_back({watched, std::chrono::system_clock::now()});
  }
  wake();
}

void Notes::addChange() {
  {
    const std::lock_guard lock(mutex_);
    change_ = true;
  }
  wake();
}

std::optional<Note> Notes::takeCall() {
  const std::lock_guard lock(mutex_);
  if (calls_.empty()) return {};
  const Note note = calls_.front();
  calls_.pop_front();
  return note;
}

bool Notes::takeChange() {
  const std::lock_guard lock(mutex_);
  return std::exchange(change_, false);
}

void Notes::forgetCalls(const Watched *watched) {
  const std::lock_guard lock(mutex_);
  std::erase_if(calls_, [watched](const Note &note) { return note.watched == watched; });
}

void Notes::forgetAllCalls() {
  const std::lock_guard lock(mutex_);
  calls_.clear();
}

/* The counter cannot overflow in a lifetime, and a signal that is there already is enough: neither
 * call has a failure to answer. */
void Notes::wake() {
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t written = ::write(signal_.get(), &one, sizeof one);
}

void Notes::seen() {
  uint64_t count = 0;
  [[maybe_unused]] const ssize_t taken = ::read(signal_.get(), &count, sizeof count);
}

}  // namespace cli
