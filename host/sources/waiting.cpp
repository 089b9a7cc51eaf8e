/* Descriptors, the stop signal (an eventfd) and the wait for either. No lock. */
#include "host/sources/waiting.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

namespace host {

Descriptor::Descriptor(int fd, const char *what) : fd_(fd) {
  if (fd < 0) throw std::system_error(errno, std::generic_category(), what);
}

Descriptor::~Descriptor() {
  close(fd_);
}

StopSignal::StopSignal() : event_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK), "eventfd") {}

void StopSignal::give() {
  eventfd_write(event_.get(), 1);
}

bool waitReadable(int fd, const StopSignal &stop) {
  pollfd waits[] = {{stop.descriptor(), POLLIN, 0}, {fd, POLLIN, 0}};
  while (poll(waits, 2, -1) < 0) {
    if (errno != EINTR) throw std::system_error(errno, std::generic_category(), "poll");
  }
  return waits[0].revents == 0;
}

}  // namespace host
