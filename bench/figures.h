/* What the benchmarks have said: medians, ratios, limits and the verdict on each bar; printed as text
 * and written as JSON. A ratio is the median of the ratios of each round, in which both were measured
 * within a moment. Main thread. */
#pragma once

#include <benchmark/benchmark.h>

#include <cmath>
#include <map>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

#include "bench/bench.h"

namespace bench {

class Figures : public benchmark::BenchmarkReporter {
 public:
  bool ReportContext(const Context &) override { return true; }
  void ReportRuns(const std::vector<Run> &runs) override;

  void print() const;
  nlohmann::ordered_json json() const;
  bool failed() const { return failed_; } /* a benchmark refused to measure */

 private:
  using Rounds = std::vector<double>; /* what each has said */
  struct Figure {
    double median = NAN;      /* not a number when it was not measured */
    double spreadPercent = 0; /* half the distance between the quartiles, of the median */
  };
  struct Verdict {
    std::string text, against; /* against: the fastest peer, or empty for a count */
    double most;
    Figure got;
    bool measured() const { return !std::isnan(got.median); }
    bool met() const { return got.median <= most; }
  };
  struct Judged {
    Verdict bar;
    std::vector<Verdict> floor; /* of one that is missed: one, if it was measured */
  };

  struct Line {
    Subject subject;
    Figure nanoseconds;
    Figure ratio; /* ours to this; not measured of ours itself */
  };

  static Figure figureOf(Rounds values);
  const Rounds *find(const Subject &subject) const;
  Figure ratio(const Bar &bar, const Subject &peer) const;
  std::vector<Line> inOrder() const;
  Verdict judge(const Bar &bar) const;
  std::vector<Judged> verdicts() const;

  std::map<Subject, Rounds> nanoseconds_;
  bool failed_ = false;
};

}  // namespace bench
