/* What the benchmarks share: how work, peers and limits are named, what is asked of our figures, and
 * which processor runs what. Google Benchmark runs them; figures.h keeps what they say. */
#pragma once

#include <benchmark/benchmark.h>

#include <cstdint>
#include <string>
#include <vector>

#include "bench/clock.h"

namespace bench {

inline const std::string OURS = "ours";

/* ---- What is measured ------------------------------------------------------------------------ */

/* What has the same `work` is compared; `who` is OURS or a peer's name. */
struct Subject {
  std::string work, who = OURS;
  auto operator<=>(const Subject &) const = default;
};

/* As the benchmark library knows the subject. */
std::string nameOf(const Subject &subject);

/* Remembers the subject's place in the order of the table, and what measures it. */
benchmark::internal::Benchmark *add(const Subject &subject,
                                    benchmark::internal::Benchmark *measured);

/* Function takes a benchmark::State. It is called once a round; rounds.h says in which order. */
template <typename Function>
benchmark::internal::Benchmark *measure(const Subject &subject, Function function) {
  return add(subject, benchmark::RegisterBenchmark(nameOf(subject).c_str(), function));
}

/* The name of a subject that is no peer but the least that the machine allows. */
inline std::string limit(const std::string &what) {
  return "limit: " + what;
}

/* The subject cannot be measured on this machine, and why. */
void notMeasured(const Subject &subject, const std::string &why);

/* A benchmark whose time is that of so many pieces of work sets this counter: figures are for one. */
inline constexpr const char *ITEMS = "items";

/* Turns single times in nanoseconds (at least one; sorted by this) into the figures of the subjects
 * "<work>, p50" and "<work>, p99". The subject's own figure is then the mean as always. */
void percentiles(benchmark::State &state, std::vector<double> &nanoseconds);

/* ---- What is asked of it --------------------------------------------------------------------- */

/* Ours, less the baseline, takes at most `most` times what the fastest of the peers takes, less the
 * baseline. A baseline is the same surrounding work with nothing in it. */
struct Bar {
  std::string text; /* what is asked, for a reader */
  Subject ours;
  double most;
  std::vector<Subject> peers;
  std::vector<Subject> baseline = {}; /* none or one */
  std::vector<Subject> growth = {};   /* none; or two: a peer may grow by as much as the first grows
                                         to the second */
};
void ask(const Bar &bar);

/* The usual one: our figure of this work against the fastest of these peers. */
void ask(const std::string &work, double most, const std::vector<std::string> &peers);

/* Where a bar of this text is missed: what the machine, or a rule that ours has to keep, does not go
 * below, measured in the same run. Ours is at its floor when it takes at most a fifth more. */
inline constexpr double AT_FLOOR = 1.2;
void nameFloor(Bar bar); /* whose `most` is AT_FLOOR, whatever it was */
void nameFloor(const std::string &work, const std::string &limit);

/* Something that is counted, not timed: the count must be at most `most`. Said while or after the
 * benchmarks run; said several times, the largest count stands. */
void askCount(const std::string &text, uint64_t count, uint64_t most);

/* A figure to be shown that nothing is asked of, such as bytes a node. */
void state(const std::string &text, double value, const std::string &unit);

/* ---- Where it runs --------------------------------------------------------------------------- */

/* Binds the calling thread to one processor (counted modulo those at hand), or to all of them. What
 * it starts afterwards inherits that. The main thread runs on 0. */
void pin(unsigned processor);
void unpin();

/* In its life all other threads that there were at its beginning, the kernel's too, and those that they
 * start, run on that processor only; afterwards on all of them. */
class OthersPinned {
 public:
  explicit OthersPinned(unsigned processor);
  ~OthersPinned();
  OthersPinned(const OthersPinned &) = delete;
  OthersPinned &operator=(const OthersPinned &) = delete;
};

}  // namespace bench
