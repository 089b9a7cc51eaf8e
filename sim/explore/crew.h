/* Child processes that play: a run may stop the system, crash, or never end, and the searcher must
 * outlive it. One thread; the kernel keeps the processes apart.
 */
#pragma once

#include <sys/types.h>

#include <chrono>
#include <csignal>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace sim {

/* How a run ended that did not end well. */
struct Failure {
  std::string message; /* the line that says what */
  std::string text;    /* everything that was printed, reports and backtrace included */

  /* The message without numbers and addresses, which differ between equal faults. */
  std::string kind() const;
};

class Crew {
 public:
  /* `patience`: real time after which a run that makes no step is ended with a report. */
  explicit Crew(unsigned jobs, std::chrono::milliseconds patience = std::chrono::seconds(60));
  ~Crew(); /* ends the children that are left */
  Crew(const Crew &) = delete;
  Crew &operator=(const Crew &) = delete;

  unsigned jobs() const { return static_cast<unsigned>(members_.size()); }

  /* A member, below jobs() and not busy, does `work` in a process of its own, whose output is kept.
   */
  void start(unsigned member, const std::function<void()> &work);

  struct Ending {
    unsigned member;
    std::optional<Failure> failure; /* none: the work was done */
  };
  /* The next member that has ended; nothing when none has within this time, or when the program was
   * told to end. */
  std::optional<Ending> wait(std::chrono::milliseconds time);

  bool busy() const;
  bool interrupted() const { return interrupted_; } /* SIGINT or SIGTERM came */
  void forgetInterrupt() { interrupted_ = false; }  /* what was to end has ended */
  void stop();                                      /* ends all members at once */

  /* Does the work in one child and waits for its end. */
  std::optional<Failure> alone(const std::function<void()> &work);

  /* In a child: a run begins; what the ones before it printed is forgotten. `sparing`: it is one of
   * very many. That a module which is unloaded cannot be reached takes system calls, and only one of
   * eight such runs makes them; scenarios check themselves that nobody is inside. */
  static void beginRun(bool sparing = false);

 private:
  struct Member {
    pid_t process = 0; /* 0: not busy */
    int output = -1;   /* a file in memory */
  };
  [[noreturn]] void become(const Member &member, const std::function<void()> &work);
  std::optional<Ending> ended();
  std::string printed(const Member &member) const;

  std::vector<Member> members_;
  std::chrono::milliseconds patience_;
  sigset_t awaited_;  /* blocked, and fetched in wait() */
  sigset_t previous_; /* the mask from before */
  bool interrupted_ = false;
};

}  // namespace sim
