/* Processes, their output, their ends, and the watchdog in each. The handlers of signals run on a
 * stack of their own and end in a panic, whose report is the best that can still be had.
 */
#include "sim/explore/crew.h"

#include <malloc.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <system_error>

#include "host/kernel/module_loader.h"
#include "host/kernel/panic.h"
#include "sim/access/access.h"
#include "sim/sanitizers.h"
#include "sim/scheduler.h"

namespace sim {

namespace {

[[noreturn]] void giveUp(const char *what) {
  throw std::system_error(errno, std::generic_category(), what);
}

/* ---- In a child ------------------------------------------------------------------------------ */

constexpr int looksInPatience = 4;
constexpr unsigned reportSeconds = 20; /* for the report of one that is stuck or has crashed */

constexpr uint64_t sparingRuns = 8; /* one of so many is not sparing after all */

uint64_t runsBegun = 0;
double patienceSeconds = 0;
bool outOfReach = true; /* modules that are unloaded in this run */

/* The report may hang in its turn, in a lock that the interrupted code holds. */
void endSoon() {
  std::signal(SIGALRM, SIG_DFL);
  alarm(reportSeconds);
}

void lookForSteps(int) {
  static uint64_t lastRun = 0;
  static uint64_t lastStep = 0;
  static int looks = 0;
  const Scheduler *scheduler = Scheduler::current();
  const uint64_t step = scheduler ? scheduler->steps() : 0;
  looks = lastRun == runsBegun && lastStep == step ? looks + 1 : 0;
  lastRun = runsBegun;
  lastStep = step;
  if (looks < looksInPatience) return;
  endSoon();
  host::panic("no step within %.0f seconds of real time: it goes in circles", patienceSeconds);
}

#if !defined(SIM_ADDRESS_SANITIZER) && !defined(SIM_THREAD_SANITIZER)
void reportCrash(int signal, siginfo_t *info, void *) {
  endSoon();
  host::revealKeptModules();
  host::panic("%s at address %p", strsignal(signal), info->si_addr);
}
#endif

void handle(int signal, const struct sigaction &action) {
  if (sigaction(signal, &action, nullptr) != 0) host::panic("signal %d has no handler", signal);
}

/* What one run gives back the next one takes: no pages go to and fro between them, nor modules. */
void keepMemory() {
  constexpr int kept = 32 << 20; /* the most that malloc allows */
  mallopt(M_MMAP_THRESHOLD, kept);
  mallopt(M_TRIM_THRESHOLD, kept);
  host::keepUnloadedModules([] { return access::watching || outOfReach; });
}

void watch(std::chrono::milliseconds patience) {
  static std::array<char, size_t{512} * 1024> stack;
  const stack_t alternative{.ss_sp = stack.data(), .ss_flags = 0, .ss_size = stack.size()};
  sigaltstack(&alternative, nullptr);

  struct sigaction action {};
  action.sa_flags = SA_ONSTACK | SA_RESTART;
  action.sa_handler = &lookForSteps;
  handle(SIGALRM, action);
  patienceSeconds = static_cast<double>(patience.count()) / 1000;
  const auto microseconds = patience.count() * 1000 / looksInPatience;
  const timeval interval{.tv_sec = microseconds / 1'000'000, .tv_usec = microseconds % 1'000'000};
  const itimerval timer{.it_interval = interval, .it_value = interval};
  setitimer(ITIMER_REAL, &timer, nullptr);

#if !defined(SIM_ADDRESS_SANITIZER) && !defined(SIM_THREAD_SANITIZER)
  action.sa_flags = SA_ONSTACK | SA_SIGINFO | static_cast<int>(SA_RESETHAND);
  action.sa_sigaction = &reportCrash;
  for (const int signal : {SIGSEGV, SIGBUS, SIGFPE, SIGILL}) handle(signal, action);
#endif
}

/* ---- Failures -------------------------------------------------------------------------------- */

std::string messageOf(const std::string &text, int status) {
  for (const char *mark : {"panic: ", "Sanitizer: "}) {
    size_t begin = text.find(mark);
    if (begin == std::string::npos) continue;
    begin += std::strlen(mark);
    return text.substr(begin, text.find('\n', begin) - begin);
  }
  if (WIFSIGNALED(status)) return std::string("died of a signal: ") + strsignal(WTERMSIG(status));
  return "exited with status " + std::to_string(WEXITSTATUS(status));
}

}  // namespace

/* Numbers, decimal or hexadecimal, become a single sign. */
std::string Failure::kind() const {
  std::string plain;
  std::string word;
  const auto finish = [&] {
    const bool number = word.find_first_of("0123456789") != std::string::npos &&
                        word.find_first_not_of("0123456789abcdefx") == std::string::npos;
    plain += number ? "#" : word;
    word.clear();
  };
  for (const char letter : message) {
    if (std::isalnum(static_cast<unsigned char>(letter))) {
      word += letter;
      continue;
    }
    finish();
    plain += letter;
  }
  finish();
  return plain;
}

/* ---- The crew -------------------------------------------------------------------------------- */

Crew::Crew(unsigned jobs, std::chrono::milliseconds patience)
    : members_(jobs), patience_(patience) {
  for (Member &member : members_) {
    member.output = memfd_create("output", MFD_CLOEXEC);
    if (member.output < 0) giveUp("memfd_create");
  }
  sigemptyset(&awaited_);
  for (const int signal : {SIGCHLD, SIGINT, SIGTERM}) sigaddset(&awaited_, signal);
  sigprocmask(SIG_BLOCK, &awaited_, &previous_);
}

Crew::~Crew() {
  stop();
  for (const Member &member : members_) close(member.output);
  sigprocmask(SIG_SETMASK, &previous_, nullptr);
}

void Crew::start(unsigned number, const std::function<void()> &work) {
  Member &member = members_.at(number);
  if (ftruncate(member.output, 0) != 0) giveUp("ftruncate");
  std::fflush(nullptr); /* or the child would print it again */
  const pid_t parent = getpid();
  member.process = fork();
  if (member.process < 0) giveUp("fork");
  if (member.process != 0) return;
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (getppid() != parent) _exit(0);
  become(member, work);
}

void Crew::become(const Member &member, const std::function<void()> &work) {
  setpgid(0, 0); /* an interrupt from the terminal is for the parent, which ends its children */
  sigprocmask(SIG_SETMASK, &previous_, nullptr);
  dup2(member.output, STDOUT_FILENO);
  dup2(member.output, STDERR_FILENO);
  const rlimit none{};
  setrlimit(RLIMIT_CORE, &none);
  keepMemory();
  beginRun();
  watch(patience_);
  try {
    work();
  } catch (const std::exception &error) {
    host::panic("exception: %s", error.what());
  }
  std::fflush(nullptr);
  _exit(0);
}

void Crew::beginRun(bool sparing) {
  outOfReach = !sparing || runsBegun % sparingRuns == 0;
  ++runsBegun;
  if (lseek(STDERR_FILENO, 0, SEEK_CUR) == 0) return;
  if (lseek(STDERR_FILENO, 0, SEEK_SET) != 0 || ftruncate(STDERR_FILENO, 0) != 0)
    host::panic("the output cannot be kept");
}

std::string Crew::printed(const Member &member) const {
  const off_t size = lseek(member.output, 0, SEEK_END);
  std::string text(static_cast<size_t>(size), '\0');
  const ssize_t got = pread(member.output, text.data(), text.size(), 0);
  text.resize(static_cast<size_t>(got > 0 ? got : 0));
  return text;
}

std::optional<Crew::Ending> Crew::ended() {
  for (unsigned number = 0; number < jobs(); ++number) {
    Member &member = members_[number];
    int status = 0;
    if (member.process == 0 || waitpid(member.process, &status, WNOHANG) != member.process)
      continue;
    member.process = 0;
    Ending ending{.member = number, .failure = std::nullopt};
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return ending;
    const std::string text = printed(member);
    ending.failure = Failure{.message = messageOf(text, status), .text = text};
    return ending;
  }
  return std::nullopt;
}

std::optional<Crew::Ending> Crew::wait(std::chrono::milliseconds time) {
  const auto until = std::chrono::steady_clock::now() + time;
  while (busy() && !interrupted_) {
    if (std::optional<Ending> ending = ended()) return ending;
    const auto left = std::chrono::duration_cast<std::chrono::nanoseconds>(
                          until - std::chrono::steady_clock::now())
                          .count();
    if (left <= 0) return std::nullopt;
    const timespec timeout{.tv_sec = left / 1'000'000'000, .tv_nsec = left % 1'000'000'000};
    const int signal = sigtimedwait(&awaited_, nullptr, &timeout);
    interrupted_ = signal == SIGINT || signal == SIGTERM;
  }
  return std::nullopt;
}

bool Crew::busy() const {
  for (const Member &member : members_)
    if (member.process != 0) return true;
  return false;
}

void Crew::stop() {
  for (Member &member : members_) {
    if (member.process == 0) continue;
    kill(member.process, SIGKILL);
    waitpid(member.process, nullptr, 0);
    member.process = 0;
  }
}

std::optional<Failure> Crew::alone(const std::function<void()> &work) {
  start(0, work);
  while (busy() && !interrupted_) {
    if (const auto ending = wait(std::chrono::seconds(1))) return ending->failure;
  }
  stop();
  return std::nullopt;
}

}  // namespace sim
