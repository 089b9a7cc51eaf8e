/* What a watching thread sleeps on: descriptors, and a signal that ends its sleep. No lock.
 *
 * These sleeps are the operating system's: watchers run over OS threads only.
 */
#pragma once

namespace host {

/* Owns a file descriptor. */
class Descriptor {
 public:
  /* Throws std::system_error with `what` and errno when `fd` is negative, that is, when the call
   * that made it failed. */
  Descriptor(int fd, const char *what);
  ~Descriptor();
  Descriptor(const Descriptor &) = delete;
  Descriptor &operator=(const Descriptor &) = delete;
  int get() const { return fd_; }

 private:
  const int fd_;
};

/* Once given, stands for ever. Any thread. */
class StopSignal {
 public:
  StopSignal(); /* throws std::system_error */
  void give();
  int descriptor() const { return event_.get(); }

 private:
  Descriptor event_;
};

/* Sleeps until `fd` has something to read (true) or the signal was given (false). */
bool waitReadable(int fd, const StopSignal &stop);

}  // namespace host
