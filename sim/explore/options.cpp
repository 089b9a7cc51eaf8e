/* Options and the help page. No lock. */
#include "sim/explore/options.h"

#include <CLI/CLI.hpp>
#include <thread>

namespace sim {

namespace {

constexpr const char *kFooter =
    "Strategies:\n"
    "  default             a fiber runs until it has to wait\n"
    "  random[:N]          any fiber that can run, at one step in N by chance (default 1)\n"
    "  pct[:D[:K]]         priorities that change at D - 1 of K steps by chance (default 3; K is\n"
    "                      measured)\n"
    "  exhaustive[:P]      every schedule with at most P preemptions (default 2), plan after plan\n"
    "  portfolio           all of these in turn\n\n"
    "Examples:\n"
    "  karst-sim                                   searches everything until Ctrl-C\n"
    "  karst-sim --scenario churn --steps 1e9      one scenario, a thousand million steps\n"
    "  karst-sim --scenario churn --seed 42 --strategy pct:3:4096 --runs 1\n"
    "                                              the run that a search had with these values\n"
    "  karst-sim --scenario churn --seed 42 --operations ... --schedule ...\n"
    "                                              a case as a failure's report prints it\n"
    "  karst-sim --check-determinism 1000          each of 1000 runs twice, which must not differ\n"
    "  karst-sim --regressions cases.txt           every case of a file; all must pass\n\n"
    "A failure is shortened and printed with its plan, what happened, and the line that plays it\n"
    "again. Run i of a search has the seed of --seed plus i.\n\n"
    "Exit status:\n"
    "  0    nothing was found\n"
    "  1    a failure was found\n"
    "  2    the command line is wrong; the message on standard error says what to do\n"
    "  130  interrupted before the first run had ended\n";

/* "1e9" as well as "1000000000". */
uint64_t countFrom(const std::string &text) {
  size_t used = 0;
  double count = -1;
  try {
    count = std::stod(text, &used);
  } catch (const std::exception &) {
    used = 0;
  }
  if (used != text.size() || count < 1 || count > 1e18)
    throw UsageError("\"" + text + "\" is no number of runs or steps");
  return static_cast<uint64_t>(count);
}

/* The options, and what they are read into before it is completed. */
struct CommandLine {
  explicit CommandLine(const ExploreDefaults &defaults);
  Options complete(const ExploreDefaults &defaults);

  CLI::App app{
      "Plays scenarios on the simulated machine, each by many schedules and with many\n"
      "failures, and shortens what it finds."};
  Options options;
  std::string runs, steps;
  std::string operations, faults, schedule;
  std::string module;
  bool watched = false, plain = false;
};

CommandLine::CommandLine(const ExploreDefaults &defaults) {
  app.name(defaults.program);
  app.footer(kFooter);
  app.add_flag("--list", options.list, "Print the scenarios");
  app.add_option("--scenario", options.scenario, "A scenario, or all (the default)")
      ->type_name("NAME");
  app.add_option("--seed", options.seed, "Of the first run; 1 by default")->type_name("N");
  app.add_option("--strategy", options.strategy, "How schedules are chosen; portfolio by default")
      ->type_name("STRATEGY");
  app.add_option("--steps", steps, "Ends after so many steps of the scheduler in all runs together")
      ->type_name("N");
  app.add_option("--runs", runs, "Ends after so many runs")->type_name("N");
  app.add_option("--length", options.length,
                 "Operations of a run; otherwise the scenario's own number")
      ->type_name("N");
  app.add_option("--operations", operations, "Plays just this plan")->type_name("TEXT");
  app.add_option("--faults", faults, "With these failures of platform calls")->type_name("TEXT");
  app.add_option("--schedule", schedule, "By this schedule")->type_name("TEXT");
  app.add_option("--module", module, "The module's file")->type_name("FILE");
  auto *watchedFlag =
      app.add_flag("--watched", watched, "Use " + defaults.watched + " (the default)");
  app.add_flag("--plain", plain, "Use " + defaults.plain)->excludes(watchedFlag);
  options.jobs = std::max(1u, std::thread::hardware_concurrency());
  app.add_option("--jobs", options.jobs, "Processes that play; one a core by default")
      ->type_name("N")
      ->check(CLI::Range(1u, 256u));
  app.add_option("--shorten-runs", options.shortenRuns,
                 "Most runs for shortening a failure; 4000 by default, 0 for none")
      ->type_name("N");
  app.add_option("--check-determinism", options.determinismRuns, "Plays so many runs twice")
      ->type_name("N");
  app.add_option("--regressions", options.regressions, "Plays all cases of a file")
      ->type_name("FILE");
  app.add_option("--json", options.json, "Write the figures to a file")->type_name("FILE");
}

/* Its own, or one beside the program. */
void chooseModule(CommandLine &line, const ExploreDefaults &defaults) {
  Options &options = line.options;
  options.moduleChosen = !line.module.empty() || line.watched || line.plain;
  if (!line.module.empty()) {
    options.module = std::filesystem::absolute(line.module);
    options.moduleOption = "--module " + line.module;
    return;
  }
  const std::filesystem::path folder =
      std::filesystem::read_symlink("/proc/self/exe").parent_path();
  const bool haveWatched = std::filesystem::exists(folder / defaults.watched);
  const bool watched = line.watched || (haveWatched && !line.plain);
  options.module = folder / (watched ? defaults.watched : defaults.plain);
  options.moduleOption = watched ? "--watched" : "--plain";
}

Options CommandLine::complete(const ExploreDefaults &defaults) {
  if (!runs.empty()) options.budget.runs = countFrom(runs);
  if (!steps.empty()) options.budget.steps = countFrom(steps);
  if (!operations.empty()) options.operations = operations;
  if (!faults.empty()) options.faults = faults;
  if (!schedule.empty()) options.schedule = schedule;
  if (options.oneCase() && options.scenario == "all")
    throw UsageError("a plan or a schedule belongs to a scenario; give --scenario NAME");
  chooseModule(*this, defaults);
  return options;
}

}  // namespace

std::optional<Options> parseOptions(int argc, char **argv, const ExploreDefaults &defaults) {
  CommandLine line(defaults);
  try {
    line.app.parse(argc, argv);
  } catch (const CLI::Success &asked) {
    line.app.exit(asked);
    return std::nullopt;
  } catch (const CLI::ParseError &error) {
    throw UsageError(std::string(error.what()) + "\n" + defaults.program + " --help shows how");
  }
  Options options = line.complete(defaults);
  if (options.moduleChosen && !std::filesystem::exists(options.module))
    throw UsageError(options.module.string() +
                     ": there is no such file; build it, or give another --module");
  return options;
}

Options parseLine(const std::string &text, const ExploreDefaults &defaults) {
  CommandLine line(defaults);
  try {
    line.app.parse(text);
  } catch (const CLI::ParseError &error) {
    throw UsageError(text + ": " + error.what());
  }
  return line.complete(defaults);
}

}  // namespace sim
