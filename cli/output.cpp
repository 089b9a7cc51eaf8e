/* Writing to standard output. No lock. */
#include "cli/output.h"

#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <system_error>

namespace cli {

void Output::write(std::string_view text) {
  while (!text.empty() && !readerGone_) {
    const ssize_t written = ::write(STDOUT_FILENO, text.data(), text.size());
    if (written >= 0) {
      text.remove_prefix(static_cast<size_t>(written));
    } else if (errno == EPIPE) {
      readerGone_ = true;
    } else if (errno == EAGAIN) { /* somebody made the descriptor we were given non-blocking */
      pollfd room{STDOUT_FILENO, POLLOUT, 0};
      ::poll(&room, 1, -1);
    } else if (errno != EINTR) {
      throw std::system_error(errno, std::generic_category(), "standard output");
    }
  }
}

bool Output::colour() const {
  const char *const unwanted = std::getenv("NO_COLOR");
  return ::isatty(STDOUT_FILENO) != 0 && (unwanted == nullptr || *unwanted == '\0');
}

}  // namespace cli
