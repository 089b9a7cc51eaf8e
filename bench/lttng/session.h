/* A session of the peer's tracer, with a daemon of its own that nobody else on the machine sees. */
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <memory>

#include "bench/lttng/provider.h"

namespace bench {

/* A folder of one's own that goes with the object. */
class TemporaryFolder {
 public:
  TemporaryFolder();
  ~TemporaryFolder();
  TemporaryFolder(const TemporaryFolder &) = delete;
  TemporaryFolder &operator=(const TemporaryFolder &) = delete;
  const std::filesystem::path &path() const { return path_; }

 private:
  std::filesystem::path path_;
};

/* A program that runs until the object goes. */
class Daemon {
 public:
  explicit Daemon(const char *const command[]);
  ~Daemon();
  Daemon(const Daemon &) = delete;
  Daemon &operator=(const Daemon &) = delete;

 private:
  pid_t process_ = 0;
};

/* Records what the provider's first tracepoints say into a ring of 1 MiB a processor, as ours, that
 * is overwritten and never written to a file. Made while the program has one thread. Throws
 * std::runtime_error with the reason when it cannot be had here. */
class LttngSession {
 public:
  LttngSession();

  decltype(benchTracepointsOn) *tracepointsOn;
  decltype(benchTracepointsOff) *tracepointsOff;
  decltype(benchClockMatched) *clockMatched;

 private:
  TemporaryFolder home_;
  std::unique_ptr<Daemon> daemon_;
};

}  // namespace bench
