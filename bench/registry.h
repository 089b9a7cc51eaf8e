/* What has been said with the functions of bench.h, for the figures to be judged by. */
#pragma once

#include <map>
#include <string>
#include <vector>

#include "bench/bench.h"

namespace bench {

struct Count {
  std::string text;
  uint64_t count, most;
};

struct Statement {
  std::string text;
  double value;
  std::string unit;
};

struct Registry {
  std::vector<Subject> subjects; /* in the order in which they were first named */
  std::map<Subject, benchmark::internal::Benchmark *> benchmarks;
  std::map<Subject, std::string> notMeasured; /* and why */
  std::vector<Bar> bars;
  std::vector<Bar> floors;
  std::vector<Count> counts;
  std::vector<Statement> statements;
};

Registry &registry();

/* The subject that the benchmark library knows by this name. */
Subject subjectOf(const std::string &name);

inline constexpr const char *P50 = "p50", *P99 = "p99"; /* counters, in nanoseconds */

/* The work that is measured to get the figures of this one, which may be a percentile. */
std::string measuredWork(const std::string &work);

}  // namespace bench
