/* karst-bench: our hot paths beside their peers, in one process, in rounds, so that what disturbs the
 * machine disturbs both. --help says which options there are.
 * Exit status: 0 measured, whatever the verdicts; 1 something could not be; 2 an option is wrong. */
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fstream>
#include <nlohmann/json.hpp>
#include <regex>
#include <stdexcept>

#include "bench/rounds.h"
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

/* The registered benchmarks hold instances, which go before the cluster. */
struct Registered {
  Registered() = default;
  ~Registered() { benchmark::ClearRegisteredBenchmarks(); }
  Registered(const Registered &) = delete;
  Registered &operator=(const Registered &) = delete;
};

int run(size_t rounds, const std::string &filter, const std::string &jsonFile) {
  bench::Cluster cluster; /* its threads run on all processors */
  const Registered registered;
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
  if (!bench::measureInRounds(rounds, filter, figures)) {
    throw std::invalid_argument("nothing that is measured has a name like " + filter);
  }
  printLoad("after");
  std::printf(
      "medians of %zu rounds, times and ratios; +- is half the distance between the quartiles\n",
      rounds);
  figures.print();
  if (!jsonFile.empty()) write(jsonFile, figures.json());
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

void printHelp() {
  std::printf(
      "karst-bench measures the resolver's hot paths beside their peers, and says which bars are "
      "met.\n"
      "\n"
      "  --rounds=N                  how often each subject is measured; 15 if not said\n"
      "  --json=FILE                 write figures and verdicts, for tools/plot-bench\n"
      "  --benchmark_filter=REGEX    only subjects with such a name, \"map: churn, n = 128 | "
      "ours\"\n"
      "  --benchmark_min_time=S      seconds of each measurement, at least; 0.02 if not said\n");
}

/* Throws std::invalid_argument. */
size_t numberOf(const std::string &text) {
  size_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || *end != '\0' || number == 0) {
    throw std::invalid_argument("--rounds takes a number from 1 up, and not " + text);
  }
  return number;
}

}  // namespace

int main(int argc, char **argv) {
  /* Defaults: an option that is given comes later and wins. */
  char interleaved[] = "--benchmark_enable_random_interleaving=true";
  char seconds[] = "--benchmark_min_time=0.02";
  std::vector<char *> arguments{argv[0], interleaved, seconds};
  arguments.insert(arguments.end(), argv + 1, argv + argc);
  const std::string jsonFile = takeOption(arguments, "--json=");
  const std::string rounds = takeOption(arguments, "--rounds=");
  int count = static_cast<int>(arguments.size());
  arguments.push_back(nullptr);
  benchmark::Initialize(&count, arguments.data(), printHelp);
  if (benchmark::ReportUnrecognizedArguments(count, arguments.data())) return 2;
  host::setLogThreshold(host::LogThreshold::Warning);
  try {
    return run(rounds.empty() ? 15 : numberOf(rounds), benchmark::GetBenchmarkFilter(), jsonFile);
  } catch (const std::exception &error) {
    std::fprintf(stderr, "karst-bench: %s\n", error.what());
    const bool asked = dynamic_cast<const std::invalid_argument *>(&error) != nullptr ||
                       dynamic_cast<const std::regex_error *>(&error) != nullptr;
    return asked ? 2 : 1;
  }
}
