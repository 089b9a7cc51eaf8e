/* Daemon, session and provider of the peer's tracer; see session.h. */
#include "bench/lttng/session.h"

#include <dlfcn.h>
#include <sched.h>
#include <spawn.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>
#include <thread>

namespace bench {
namespace {

[[noreturn]] void fail(const std::string &what, const std::string &why) {
  throw std::runtime_error(what + ": " + why);
}

/* Root's daemon has its sockets in one place for the whole machine, /run; so root gets a view of the
 * file system with an empty one. Anyone else's are in LTTNG_HOME. */
void hideSockets(const std::filesystem::path &home) {
  setenv("LTTNG_HOME", home.c_str(), 1);
  if (geteuid() != 0) return;
  if (unshare(CLONE_NEWNS) != 0 ||
      mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      mount("none", "/run", "tmpfs", 0, nullptr) != 0) {
    fail("no /run of its own", std::strerror(errno));
  }
}

bool succeeds(const std::string &command) {
  return std::system((command + " >/dev/null 2>&1").c_str()) == 0;
}

void awaitDaemon() {
  for (int tries = 0; tries < 100; tries++) {
    if (succeeds("lttng --no-sessiond list")) return;
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  fail("lttng-sessiond", "does not answer");
}

template <typename Function>
Function *find(void *library, const char *name) {
  void *const function = dlsym(library, name);
  if (function == nullptr) fail("the tracepoint provider", std::string("has no ") + name);
  return reinterpret_cast<Function *>(function);
}

void startSession() {
  for (const char *command :
       {"create bench --snapshot",
        "enable-channel --userspace --overwrite --num-subbuf=4 --subbuf-size=256K ring",
        "enable-event --userspace --channel=ring karst_bench:on", "start"}) {
    if (!succeeds(std::string("lttng --no-sessiond ") + command)) fail("lttng", command);
  }
}

}  // namespace

TemporaryFolder::TemporaryFolder() {
  std::string name = std::filesystem::temp_directory_path() / "karst-bench-XXXXXX";
  if (mkdtemp(name.data()) == nullptr) fail(name, std::strerror(errno));
  path_ = name;
}

TemporaryFolder::~TemporaryFolder() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

Daemon::Daemon(const char *const command[]) {
  posix_spawn_file_actions_t files;
  posix_spawn_file_actions_init(&files);
  for (const int file : {STDOUT_FILENO, STDERR_FILENO}) {
    posix_spawn_file_actions_addopen(&files, file, "/dev/null", O_WRONLY, 0);
  }
  const int error = posix_spawnp(&process_, command[0], &files, nullptr,
                                 const_cast<char *const *>(command), environ);
  posix_spawn_file_actions_destroy(&files);
  if (error != 0) fail(command[0], std::strerror(error));
}

Daemon::~Daemon() {
  kill(process_, SIGTERM);
  waitpid(process_, nullptr, 0);
}

LttngSession::LttngSession() {
  hideSockets(home_.path());
  /* Ends with us, however we end. */
  const char *const command[] = {"setpriv", "--pdeathsig=TERM", "lttng-sessiond", "--no-kernel",
                                 nullptr};
  daemon_ = std::make_unique<Daemon>(command);
  awaitDaemon();
  /* The tracer's library looks for the daemon when it is loaded, and stays to the program's end. */
  void *const provider = dlopen(LTTNG_PROVIDER_SO, RTLD_NOW);
  if (provider == nullptr) fail("the tracepoint provider", dlerror());
  tracepointsOn = find<decltype(benchTracepointsOn)>(provider, "benchTracepointsOn");
  tracepointsOff = find<decltype(benchTracepointsOff)>(provider, "benchTracepointsOff");
  clockMatched = find<decltype(benchClockMatched)>(provider, "benchClockMatched");
  if (!find<decltype(benchClockInstall)>(provider, "benchClockInstall")()) {
    fail("LTTng-UST", "refuses another clock");
  }
  startSession();
  if (!find<decltype(benchTracepointsAreSelected)>(provider, "benchTracepointsAreSelected")()) {
    fail("LTTng-UST", "the session does not select the tracepoints");
  }
}

}  // namespace bench
