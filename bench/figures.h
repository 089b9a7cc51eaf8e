/* What the benchmarks have said: medians, ratios, limits and the verdict on each bar; printed as text
 * and written as JSON. Main thread. */
#pragma once

#include <benchmark/benchmark.h>

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
  struct Figure {
    double nanoseconds;   /* median over the repetitions */
    double spreadPercent; /* half the distance between the quartiles, of the median */
  };
  struct Verdict {
    std::string text, against; /* against: the fastest peer, or empty for a count */
    double most, got;          /* got is not a number when not all of it was measured */
    bool measured() const { return got == got; }
    bool met() const { return got <= most; }
  };
  struct Judged {
    Verdict bar;
    std::vector<Verdict> floor; /* of one that is missed: one, if it was measured */
  };

  const Figure *find(const Subject &subject) const;
  std::vector<std::pair<Subject, Figure>> inOrder() const;
  Verdict judge(const Bar &bar) const;
  std::vector<Judged> verdicts() const;

  std::map<Subject, Figure> figures_;
  bool failed_ = false;
};

}  // namespace bench
