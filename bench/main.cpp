/* karst-bench: our hot paths beside their peers, in one process, repetitions interleaved in random
 * order, so that what disturbs the machine disturbs both. Takes Google Benchmark's options. */
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <map>

#include "bench/bench.h"
#include "host/kernel/log.h"

namespace {

/* Keeps the medians, and prints our work's ratio to each of its peers'. */
class Table : public benchmark::BenchmarkReporter {
 public:
  bool ReportContext(const Context &) override { return true; }
  void ReportRuns(const std::vector<Run> &runs) override;
  void print() const;
  bool failed() const { return failed_; } /* a benchmark refused to measure */

 private:
  struct Figure {
    std::string work, who;
    double nanoseconds;   /* median over the repetitions */
    double spreadPercent; /* half the distance between the quartiles, of the median */
  };
  std::map<int64_t, Figure> figures_; /* in the order in which they were registered */
  bool failed_ = false;
};

void Table::ReportRuns(const std::vector<Run> &runs) {
  std::vector<double> times;
  for (const Run &run : runs) {
    if (run.error_occurred) {
      std::fprintf(stderr, "%s: %s\n", run.benchmark_name().c_str(), run.error_message.c_str());
      failed_ = true;
      return;
    }
    if (run.run_type != Run::RT_Iteration) continue;
    const auto items = run.counters.find(bench::ITEMS);
    const double divisor = items == run.counters.end() ? 1 : items->second.value;
    times.push_back(run.GetAdjustedRealTime() / divisor);
  }
  if (times.empty()) return;
  std::sort(times.begin(), times.end());
  const double median = times[times.size() / 2];
  const double spread = (times[times.size() * 3 / 4] - times[times.size() / 4]) / 2;
  const std::string &name = runs.front().run_name.function_name;
  const size_t end = name.find(bench::SEPARATOR);
  figures_[runs.front().family_index] = {name.substr(0, end),
                                         name.substr(end + bench::SEPARATOR.size()), median,
                                         100 * spread / median};
}

void Table::print() const {
  std::printf("%-34s %10s %6s   %-32s %10s %6s %7s\n", "work", "ours ns", "+-", "peer", "peer ns",
              "+-", "ratio");
  for (const auto &[index, ours] : figures_) {
    if (ours.who != bench::OURS) continue;
    for (const auto &[peerIndex, peer] : figures_) {
      if (peer.work != ours.work || peerIndex == index) continue;
      std::printf("%-34s %10.1f %5.1f%%   %-32s %10.1f %5.1f%% %7.2f\n", ours.work.c_str(),
                  ours.nanoseconds, ours.spreadPercent, peer.who.c_str(), peer.nanoseconds,
                  peer.spreadPercent, ours.nanoseconds / peer.nanoseconds);
    }
  }
}

void printLoad(const char *when) {
  double load[1] = {};
  if (getloadavg(load, 1) == 1) std::printf("load %s: %.2f\n", when, load[0]);
  std::fflush(stdout);
}

int run() {
  bench::Cluster cluster;
  bench::measureMap(cluster);
  bench::measureTrace(cluster);
  bench::measureReadOut(cluster);
  bench::measureChange(cluster);

  printLoad("before");
  Table table;
  benchmark::RunSpecifiedBenchmarks(&table);
  printLoad("after");
  std::printf("medians of real time; +- is half the distance between the quartiles\n\n");
  table.print();
  benchmark::ClearRegisteredBenchmarks(); /* they hold instances, which go before the cluster */
  return table.failed() ? 1 : 0;
}

}  // namespace

int main(int argc, char **argv) {
  /* Defaults: an option that is given comes later and wins. */
  char interleaved[] = "--benchmark_enable_random_interleaving=true";
  char repetitions[] = "--benchmark_repetitions=15";
  char seconds[] = "--benchmark_min_time=0.02";
  std::vector<char *> arguments{argv[0], interleaved, repetitions, seconds};
  arguments.insert(arguments.end(), argv + 1, argv + argc);
  int count = static_cast<int>(arguments.size());
  arguments.push_back(nullptr);
  benchmark::Initialize(&count, arguments.data());
  if (benchmark::ReportUnrecognizedArguments(count, arguments.data())) return 2;
  host::setLogThreshold(host::LogThreshold::Warning);
  try {
    return run();
  } catch (const std::exception &error) {
    std::fprintf(stderr, "karst-bench: %s\n", error.what());
    return 1;
  }
}
