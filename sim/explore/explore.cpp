/* From the options to the exit status: which searches are made, and what is printed. One thread. */
#include "sim/explore/explore.h"

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <nlohmann/json.hpp>

#include "host/kernel/text.h"
#include "sim/explore/options.h"
#include "sim/explore/search.h"
#include "sim/explore/shorten.h"

namespace sim {

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kNothingFound = 0;
constexpr int kFound = 1;
constexpr int kUsage = 2;
constexpr int kInterrupted = 130;

constexpr size_t reportLines = 300;               /* of what happened */
constexpr size_t reportHistory = size_t{1} << 18; /* calls, so that locks held are followed */

unsigned long long wide(double number) {
  return static_cast<unsigned long long>(std::llround(number));
}

/* "12.3 M": short enough for a line of progress. */
std::string inShort(double number) {
  const char *const units[] = {"", " k", " M", " G", " T"};
  size_t unit = 0;
  for (; number >= 10'000 && unit < 4; ++unit) number /= 1000;
  return host::formatText(unit == 0 ? "%.0f%s" : "%.1f%s", number, units[unit]);
}

/* Steps a second of processor time, of all or of one scenario. */
template <typename Account>
double rate(const Account &account) {
  return account.processorSeconds > 0
             ? static_cast<double>(account.steps) / account.processorSeconds
             : 0;
}

/* ---- The command ----------------------------------------------------------------------------- */

class Explorer {
 public:
  Explorer(Options options, const std::vector<std::unique_ptr<Scenario>> &all,
           const ExploreDefaults &defaults);
  int run();

 private:
  std::vector<const Scenario *> chosen(const std::string &name) const;
  Case caseFrom(const Options &written) const;

  int list() const;
  int playRegressions();
  int checkDeterminism();
  int playCase();
  int searchAll();

  std::optional<Found> search();
  std::optional<Found> searchPortfolio();
  std::optional<Found> exhaustPlans(uint32_t preemptions);
  std::optional<Found> exhaustSmall(uint64_t seed, uint64_t steps);
  std::optional<Found> byChance(const std::vector<StrategyName> &strategies, uint64_t seed,
                                const Budget &budget);
  Budget left() const;
  bool over() const;

  int report(const Found &found);
  std::string lineOf(const Case &played) const;
  std::optional<Failure> playForReport(const Case &failing, const std::filesystem::path &module);
  void print(const Case &failing, const Failure &failure);
  int finish(const std::optional<Found> &found);
  void showProgress();
  void line(const std::string &text, bool last = false);
  void summarise() const;
  void writeJson(const std::optional<Found> &found) const;

  Options options_;
  const std::vector<std::unique_ptr<Scenario>> &all_;
  ExploreDefaults defaults_;
  std::vector<const Scenario *> scenarios_;
  Crew crew_;
  Playing playing_;
  Search search_;
  bool terminal_ = isatty(STDERR_FILENO) == 1;
  Clock::time_point began_ = Clock::now();
  Clock::time_point shown_ = began_;
};

Explorer::Explorer(Options options, const std::vector<std::unique_ptr<Scenario>> &all,
                   const ExploreDefaults &defaults)
    : options_(std::move(options)),
      all_(all),
      defaults_(defaults),
      scenarios_(chosen(options_.scenario)),
      crew_(options_.jobs),
      playing_{.module = options_.module},
      search_(crew_, playing_, options_.length, [this] { showProgress(); }) {}

std::vector<const Scenario *> Explorer::chosen(const std::string &name) const {
  std::vector<const Scenario *> scenarios;
  std::string names;
  for (const auto &scenario : all_) {
    names += " " + scenario->name();
    if (name == "all" || name == scenario->name()) scenarios.push_back(scenario.get());
  }
  if (scenarios.empty())
    throw UsageError("there is no scenario \"" + name + "\"; there are:" + names);
  return scenarios;
}

int Explorer::run() {
  if (options_.list) return list();
  if (!options_.regressions.empty()) return playRegressions();
  if (options_.determinismRuns > 0) return checkDeterminism();
  if (options_.oneCase()) return playCase();
  return searchAll();
}

int Explorer::list() const {
  for (const Scenario *scenario : scenarios_)
    std::printf("%-14s %s%s\n", scenario->name().c_str(), scenario->about().c_str(),
                scenario->small() ? " (small)" : "");
  return kNothingFound;
}

/* ---- What is searched ------------------------------------------------------------------------ */

const std::vector<StrategyName> &portfolio() {
  using Kind = StrategyName::Kind;
  static const std::vector<StrategyName> strategies{{Kind::Random, 1, 0},   {Kind::Pct, 2, 0},
                                                    {Kind::Random, 20, 0},  {Kind::Pct, 3, 0},
                                                    {Kind::Random, 300, 0}, {Kind::Pct, 4, 0}};
  return strategies;
}

Budget Explorer::left() const {
  const Figures figures = search_.figures();
  return {.runs = options_.budget.runs - std::min(options_.budget.runs, figures.runs),
          .steps = options_.budget.steps - std::min(options_.budget.steps, figures.steps)};
}

bool Explorer::over() const {
  const Budget budget = left();
  return crew_.interrupted() || budget.runs == 0 || budget.steps == 0;
}

std::optional<Found> Explorer::byChance(const std::vector<StrategyName> &strategies, uint64_t seed,
                                        const Budget &budget) {
  if (std::optional<Found> found = search_.measure(scenarios_)) return found;
  return search_.byChance(
      {.scenarios = scenarios_, .strategies = strategies, .seed = seed, .twice = false}, budget);
}

/* Plan after plan, each to the end of its schedules. */
/* One plan after the other, each once: where the seed makes no difference, one is all there are. */
std::optional<Found> Explorer::exhaustPlans(uint32_t preemptions) {
  bool more = true;
  for (uint64_t seed = options_.seed; more && !over(); ++seed) {
    more = false;
    for (const Scenario *scenario : scenarios_) {
      const bool known = seed != options_.seed && scenario->plan(seed, options_.length) ==
                                                      scenario->plan(seed - 1, options_.length);
      if (known || over()) continue;
      more = true;
      if (auto found = search_.exhaust(*scenario, seed, preemptions, left())) return found;
    }
  }
  return std::nullopt;
}

std::optional<Found> Explorer::exhaustSmall(uint64_t seed, uint64_t steps) {
  constexpr uint32_t preemptions = 2;
  for (const Scenario *scenario : scenarios_) {
    if (!scenario->small() || over()) continue;
    const Budget budget{.runs = left().runs, .steps = std::min(steps, left().steps)};
    if (auto found = search_.exhaust(*scenario, seed, preemptions, budget)) return found;
  }
  return std::nullopt;
}

/* Rounds of both kinds of search. Without a budget they go on for ever; with one, the first round
 * spends a quarter of it on the small scenarios and then all that is left. */
std::optional<Found> Explorer::searchPortfolio() {
  constexpr uint64_t roundSteps = 200'000'000;
  const bool bounded = options_.budget.steps != UINT64_MAX;
  const uint64_t round = bounded ? options_.budget.steps : roundSteps;
  const auto small = static_cast<uint64_t>(
      std::count_if(scenarios_.begin(), scenarios_.end(), [](auto *one) { return one->small(); }));
  uint64_t seed = options_.seed;
  for (uint64_t planSeed = seed; !over(); ++planSeed) {
    if (options_.budget.runs == UINT64_MAX && small > 0) {
      if (auto found = exhaustSmall(planSeed, round / 4 / small)) return found;
    }
    if (over()) break;
    const uint64_t runsBefore = search_.figures().runs;
    const Budget budget{.runs = left().runs, .steps = bounded ? left().steps : roundSteps * 3 / 4};
    if (auto found = byChance(portfolio(), seed, budget)) return found;
    seed += search_.figures().runs - runsBefore;
  }
  return std::nullopt;
}

std::optional<Found> Explorer::search() {
  if (options_.strategy == "portfolio") return searchPortfolio();
  const StrategyName strategy = StrategyName::parse(options_.strategy);
  if (strategy.kind == StrategyName::Kind::Exhaustive) return exhaustPlans(strategy.parameter);
  return byChance({strategy}, options_.seed, left());
}

int Explorer::searchAll() {
  const std::optional<Found> found = search();
  return finish(found);
}

/* What differs between two runs of one process cannot be shortened by runs that are alone. */
int Explorer::checkDeterminism() {
  std::vector<StrategyName> strategies = portfolio();
  if (options_.strategy != "portfolio") strategies = {StrategyName::parse(options_.strategy)};
  std::optional<Found> found = search_.measure(scenarios_);
  if (!found)
    found = search_.byChance(
        {.scenarios = scenarios_, .strategies = strategies, .seed = options_.seed, .twice = true},
        {.runs = options_.determinismRuns, .steps = UINT64_MAX});
  options_.shortenRuns = 0;
  return finish(found);
}

/* ---- Single cases ---------------------------------------------------------------------------- */

Case Explorer::caseFrom(const Options &written) const {
  const Scenario &scenario = *chosen(written.scenario).front();
  Case read = makeCase(scenario, written.seed, {}, written.length);
  if (written.operations) read.plan = {operationsFrom(*written.operations), {}};
  if (written.faults) read.plan.faults = faultsFrom(*written.faults);
  if (written.schedule || written.strategy == "portfolio") {
    read.schedule = scheduleFrom(written.schedule.value_or("-"));
  } else {
    read.strategy = StrategyName::parse(written.strategy);
    if (!read.strategy.isOneRun())
      throw UsageError("\"" + written.strategy + "\" does not say all of one run");
  }
  return read;
}

int Explorer::playCase() {
  const Case played = caseFrom(options_);
  Shared<Outcome> outcome;
  const auto failure = crew_.alone([&] { *outcome = play(played, playing_); });
  if (crew_.interrupted()) return kInterrupted;
  if (failure) {
    print(played, *failure);
    return kFound;
  }
  std::printf("passes: %llu steps, hash %016llx, %llu operations, %llu faults, %llu checks\n",
              static_cast<unsigned long long>(outcome->steps),
              static_cast<unsigned long long>(outcome->hash),
              static_cast<unsigned long long>(outcome->operations),
              static_cast<unsigned long long>(outcome->faults),
              static_cast<unsigned long long>(outcome->checks));
  return kNothingFound;
}

int Explorer::playRegressions() {
  std::ifstream file(options_.regressions);
  if (!file) throw UsageError("cannot read " + options_.regressions.string());
  size_t played = 0, failed = 0, leftOut = 0;
  for (std::string text; std::getline(file, text) && !crew_.interrupted();) {
    if (text.empty() || text[0] == '#') continue;
    const Options written = parseLine(text, defaults_);
    const Case read = caseFrom(written);
    const std::filesystem::path &module = written.moduleChosen ? written.module : options_.module;
    if (written.moduleChosen && !std::filesystem::exists(module)) {
      ++leftOut; /* its schedule counts the steps of a module that this build does not have */
      continue;
    }
    ++played;
    const auto failure = playForReport(read, module);
    if (!failure) continue;
    ++failed;
    std::printf("fails: %s\n%s\n", text.c_str(), failure->text.c_str());
  }
  std::printf("%zu cases, %zu failed\n", played, failed);
  if (leftOut > 0) std::printf("%zu more left out, whose module is not built here\n", leftOut);
  return failed > 0 ? kFound : crew_.interrupted() ? kInterrupted : kNothingFound;
}

/* ---- What was found -------------------------------------------------------------------------- */

/* What plays the case, and nothing else, with the same module. */
std::string Explorer::lineOf(const Case &played) const {
  return options_.moduleOption + " " + replayOptions(played, options_.length);
}

/* Once more, with all that happened: a search keeps no history. */
std::optional<Failure> Explorer::playForReport(const Case &failing,
                                               const std::filesystem::path &module) {
  return crew_.alone([&] {
    History::setReportLines(reportLines);
    play(failing, {.module = module, .historyLength = reportHistory});
  });
}

void Explorer::print(const Case &failing, const Failure &failure) {
  const std::vector<std::string> actors = failing.scenario->actors();
  std::printf("\nPlan (seed %llu):\n", static_cast<unsigned long long>(failing.seed));
  for (const Operation &operation : failing.plan.operations) {
    const std::string actor =
        operation.actor < actors.size() ? actors[operation.actor] : std::to_string(operation.actor);
    std::printf("  phase %-3u %-16s %s\n", operation.phase, actor.c_str(),
                failing.scenario->describe(operation).c_str());
  }
  for (const PlannedFault &fault : failing.plan.faults)
    std::printf("  %s fails at its use %u, %u times\n", traits(fault.call).name, fault.nth,
                fault.count);

  const auto again = playForReport(failing, options_.module);
  std::printf("\n%s\n", (again ? *again : failure).text.c_str());
  if (!again && !crew_.interrupted()) std::printf("It did not fail once more, alone.\n");
  std::printf("Failure: %s\nAgain:   %s %s\n", failure.message.c_str(), defaults_.program.c_str(),
              lineOf(failing).c_str());
}

int Explorer::report(const Found &found) {
  line("found: " + found.failure.message, true);
  std::printf("Found: %s\nRun:   %s %s\n", found.failure.message.c_str(), defaults_.program.c_str(),
              lineOf(found.failing).c_str());
  std::fflush(stdout);
  if (options_.shortenRuns == 0) {
    print(found.failing, found.failure);
    return kFound;
  }
  Shortener shortener(crew_, playing_,
                      {.runs = options_.shortenRuns, .time = std::chrono::seconds(60)},
                      [this](const std::string &text) { line("shortening: " + text); });
  const std::optional<Case> fixed = shortener.fix(found);
  if (!fixed) {
    std::printf("It does not fail in the same way alone: it depends on the runs before it.\n%s\n",
                found.failure.text.c_str());
    return kFound;
  }
  const Case shortened = shortener.shorten(*fixed);
  crew_.forgetInterrupt();
  print(shortened, found.failure);
  return kFound;
}

int Explorer::finish(const std::optional<Found> &found) {
  const bool nothingDone = search_.figures().runs == 0 && crew_.interrupted();
  line("", true);
  summarise();
  if (!options_.json.empty()) writeJson(found);
  if (found) return report(*found);
  return nothingDone ? kInterrupted : kNothingFound;
}

/* ---- Figures --------------------------------------------------------------------------------- */

/* A line of progress: on a terminal it takes the place of the one before. */
void Explorer::line(const std::string &text, bool last) {
  if (terminal_) {
    std::fprintf(stderr, "\r%s\033[K%s", text.c_str(), last && !text.empty() ? "\n" : "");
  } else if (!text.empty()) {
    std::fprintf(stderr, "%s\n", text.c_str());
  }
  std::fflush(stderr);
}

void Explorer::showProgress() {
  const auto pause = std::chrono::milliseconds(terminal_ ? 900 : 9900);
  if (Clock::now() - shown_ < pause) return;
  shown_ = Clock::now();
  const Figures figures = search_.figures();
  line(inShort(static_cast<double>(figures.runs)) + " runs, " +
       inShort(static_cast<double>(figures.steps)) + " steps, " + inShort(rate(figures)) +
       " steps/s a core, " + inShort(figures.courses) + " courses, " +
       inShort(figures.successions) + " successions, " +
       inShort(static_cast<double>(figures.faults)) + " faults");
}

void Explorer::summarise() const {
  const Figures figures = search_.figures();
  std::printf("%llu runs of %zu scenarios in %.1f s, with %s\n",
              static_cast<unsigned long long>(figures.runs), scenarios_.size(),
              std::chrono::duration<double>(Clock::now() - began_).count(),
              options_.module.filename().c_str());
  std::printf("  steps        %llu, %llu a second of processor time\n",
              static_cast<unsigned long long>(figures.steps), wide(rate(figures)));
  std::printf("  operations   %llu\n", static_cast<unsigned long long>(figures.operations));
  std::printf("  faults       %llu\n", static_cast<unsigned long long>(figures.faults));
  std::printf("  checks       %llu\n", static_cast<unsigned long long>(figures.checks));
  std::printf("  courses      about %llu different ones\n", wide(figures.courses));
  std::printf("  successions  about %llu of a call directly behind another fiber's\n",
              wide(figures.successions));
  for (const Share &one : search_.shares())
    std::printf("  %-14s %7llu runs, %10llu steps, %8llu a second of processor time\n",
                one.scenario->name().c_str(), static_cast<unsigned long long>(one.runs),
                static_cast<unsigned long long>(one.steps), wide(rate(one)));
  for (const Exhausted &one : search_.exhausted())
    std::printf("  %s, seed %llu, at most %u preemptions: %llu schedules, %s\n",
                one.scenario.c_str(), static_cast<unsigned long long>(one.seed), one.preemptions,
                static_cast<unsigned long long>(one.schedules),
                one.complete ? "which are all" : "not all");
  std::fflush(stdout);
}

void Explorer::writeJson(const std::optional<Found> &found) const {
  const Figures figures = search_.figures();
  nlohmann::ordered_json json{
      {"scenario", options_.scenario},
      {"strategy", options_.strategy},
      {"seed", options_.seed},
      {"module", options_.module.filename().string()},
      {"jobs", options_.jobs},
      {"seconds", std::chrono::duration<double>(Clock::now() - began_).count()},
      {"processor_seconds", figures.processorSeconds},
      {"runs", figures.runs},
      {"steps", figures.steps},
      {"steps_per_processor_second", rate(figures)},
      {"operations", figures.operations},
      {"faults", figures.faults},
      {"checks", figures.checks},
      {"courses", wide(figures.courses)},
      {"successions", wide(figures.successions)},
      {"scenarios", nlohmann::ordered_json::array()},
      {"exhausted", nlohmann::ordered_json::array()},
      {"failure", nullptr},
  };
  for (const Share &one : search_.shares())
    json["scenarios"].push_back({{"scenario", one.scenario->name()},
                                 {"runs", one.runs},
                                 {"steps", one.steps},
                                 {"steps_per_processor_second", rate(one)}});
  for (const Exhausted &one : search_.exhausted())
    json["exhausted"].push_back({{"scenario", one.scenario},
                                 {"seed", one.seed},
                                 {"preemptions", one.preemptions},
                                 {"schedules", one.schedules},
                                 {"complete", one.complete}});
  if (found)
    json["failure"] = {{"message", found->failure.message}, {"options", lineOf(found->failing)}};
  std::ofstream(options_.json) << json.dump(2) << "\n";
}

}  // namespace

int explore(int argc, char **argv, const std::vector<std::unique_ptr<Scenario>> &scenarios,
            const ExploreDefaults &defaults) {
  try {
    const std::optional<Options> options = parseOptions(argc, argv, defaults);
    return options ? Explorer(*options, scenarios, defaults).run() : kNothingFound;
  } catch (const UsageError &error) {
    std::fprintf(stderr, "%s: %s\n", defaults.program.c_str(), error.what());
  } catch (const std::invalid_argument &error) {
    std::fprintf(stderr, "%s: %s\n", defaults.program.c_str(), error.what());
  }
  return kUsage;
}

}  // namespace sim
