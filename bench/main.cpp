/* karst-bench: our hot paths beside their peers, in one process, repetitions interleaved in random
 * order, so that what disturbs the machine disturbs both. Takes Google Benchmark's options, and
 * --json=FILE for the figures and verdicts. */
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fstream>
#include <nlohmann/json.hpp>

#include "bench/figures.h"
#include "bench/subjects.h"
#include "host/kernel/log.h"

namespace {

void printLoad(const char *when) {
  double load[1] = {};
  if (getloadavg(load, 1) == 1) std::printf("load %s: %.2f\n", when, load[0]);
  std::fflush(stdout);
}

void write(const std::string &file, const nlohmann::ordered_json &json) {
  std::ofstream out(file);
  out << json.dump(1) << "\n";
  if (!out.flush()) throw std::runtime_error(file + " cannot be written");
}

int run(const std::string &jsonFile) {
  bench::Cluster cluster; /* its threads run on all processors */
  bench::pin(0);
  bench::measureMemory(cluster);
  bench::measureMap(cluster);
  bench::measureTrace(cluster);
  bench::measureReadOut(cluster);
  bench::measureChange(cluster);
  bench::measureRefreshes(cluster);
  bench::measureRescan(cluster);

  printLoad("before");
  bench::Figures figures;
  benchmark::RunSpecifiedBenchmarks(&figures);
  printLoad("after");
  std::printf("medians of real time; +- is half the distance between the quartiles\n");
  figures.print();
  if (!jsonFile.empty()) write(jsonFile, figures.json());
  benchmark::ClearRegisteredBenchmarks(); /* they hold instances, which go before the cluster */
  return figures.failed() ? 1 : 0;
}

/* Takes the option out of the arguments. */
std::string takeOption(std::vector<char *> &arguments, const char *prefix) {
  std::string value;
  std::erase_if(arguments, [&](const char *argument) {
    if (std::strncmp(argument, prefix, std::strlen(prefix)) != 0) return false;
    value = argument + std::strlen(prefix);
    return true;
  });
  return value;
}

}  // namespace

int main(int argc, char **argv) {
  /* Defaults: an option that is given comes later and wins. */
  char interleaved[] = "--benchmark_enable_random_interleaving=true";
  char repetitions[] = "--benchmark_repetitions=15";
  char seconds[] = "--benchmark_min_time=0.02";
  std::vector<char *> arguments{argv[0], interleaved, repetitions, seconds};
  arguments.insert(arguments.end(), argv + 1, argv + argc);
  const std::string jsonFile = takeOption(arguments, "--json=");
  int count = static_cast<int>(arguments.size());
  arguments.push_back(nullptr);
  benchmark::Initialize(&count, arguments.data());
  if (benchmark::ReportUnrecognizedArguments(count, arguments.data())) return 2;
  host::setLogThreshold(host::LogThreshold::Warning);
  try {
    return run(jsonFile);
  } catch (const std::exception &error) {
    std::fprintf(stderr, "karst-bench: %s\n", error.what());
    return 1;
  }
}
