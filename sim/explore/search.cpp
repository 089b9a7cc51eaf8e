/* Giving out the runs and counting what comes back. Children write the board, the parent reads it. */
#include "sim/explore/search.h"

#include <algorithm>
#include <bit>
#include <ctime>

#include "host/kernel/panic.h"
#include "sim/history.h"

namespace sim {

namespace {

uint64_t processorNanoseconds() {
  timespec time{};
  clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
}

uint64_t later(uint64_t now, uint64_t more) {
  return more > UINT64_MAX - now ? UINT64_MAX : now + more;
}

void requireEqual(const Outcome &first, const Outcome &second) {
  if (first.hash == second.hash && first.steps == second.steps) return;
  host::panic(
      "two runs of one seed differ: %llu steps and %llu, hash %llx and %llx",
      static_cast<unsigned long long>(first.steps), static_cast<unsigned long long>(second.steps),
      static_cast<unsigned long long>(first.hash), static_cast<unsigned long long>(second.hash));
}

}  // namespace

Search::Search(Crew &crew, const Playing &playing, size_t length, std::function<void()> tick)
    : crew_(crew), playing_(playing), length_(length), tick_(std::move(tick)) {
  for (unsigned member = 0; member < crew.jobs(); ++member)
    logs_.push_back(std::make_unique<ScheduleLog>());
}

Figures Search::figures() const {
  return {.runs = board_->runs,
          .steps = board_->steps,
          .operations = board_->operations,
          .faults = board_->faults,
          .checks = board_->checks,
          .processorSeconds = static_cast<double>(board_->processorNanoseconds) / 1e9,
          .courses = board_->courses.count(),
          .successions = board_->successions.count()};
}

std::vector<Share> Search::shares() const {
  std::vector<Share> shares;
  for (size_t i = 0; i < accounts_.size(); ++i) {
    const Account &account = board_->accounts[i];
    shares.push_back({accounts_[i], account.runs, account.steps,
                      static_cast<double>(account.processorNanoseconds) / 1e9});
  }
  return shares;
}

void Search::openAccount(const Scenario &scenario) {
  if (std::find(accounts_.begin(), accounts_.end(), &scenario) != accounts_.end()) return;
  if (accounts_.size() == mostScenarios) host::panic("more scenarios than there are accounts");
  accounts_.push_back(&scenario);
}

/* ---- Watching over the children -------------------------------------------------------------- */

void Search::begin(const Budget &budget) {
  end_ = {.runs = later(board_->runs, budget.runs), .steps = later(board_->steps, budget.steps)};
  board_->next = 0;
  for (unsigned member = 0; member < crew_.jobs(); ++member) {
    Slot &slot = board_->slots[member];
    slot.processorNanoseconds = 0;
    for (uint32_t bound = 0; bound <= mostPreemptions; ++bound) {
      slot.schedules[bound] = 0;
      slot.complete[bound] = false;
    }
  }
}

std::optional<Search::Fallen> Search::watch() {
  std::optional<Fallen> fallen;
  while (!fallen && crew_.busy() && !crew_.interrupted()) {
    const std::optional<Crew::Ending> ending = crew_.wait(std::chrono::seconds(1));
    if (ending && ending->failure) fallen = Fallen{ending->member, *ending->failure};
    tick_();
  }
  crew_.stop();
  return fallen;
}

/* In a child. */
void Search::count(const Scenario &scenario, const Outcome &outcome, Slot &slot) {
  const uint64_t now = processorNanoseconds();
  const uint64_t spent = now - slot.processorNanoseconds.exchange(now);
  const auto place = std::find(accounts_.begin(), accounts_.end(), &scenario);
  Account &account = board_->accounts[static_cast<size_t>(place - accounts_.begin())];
  account.processorNanoseconds += spent;
  account.steps += outcome.steps;
  ++account.runs;
  board_->processorNanoseconds += spent;
  board_->operations += outcome.operations;
  board_->faults += outcome.faults;
  board_->checks += outcome.checks;
  board_->courses.add(outcome.hash);
  board_->steps += outcome.steps;
  ++board_->runs;
}

/* ---- By chance ------------------------------------------------------------------------------- */

StrategyName Search::complete(StrategyName strategy, const Scenario &scenario) const {
  const auto length = lengths_.find(&scenario);
  if (strategy.kind == StrategyName::Kind::Pct && strategy.length == 0 && length != lengths_.end())
    strategy.length = length->second;
  return strategy;
}

Case Search::caseOf(const Chances &chances, uint64_t run) const {
  const size_t scenarios = chances.scenarios.size();
  const Scenario &scenario = *chances.scenarios[run % scenarios];
  const StrategyName &strategy = chances.strategies[run / scenarios % chances.strategies.size()];
  return makeCase(scenario, chances.seed + run, complete(strategy, scenario), length_);
}

void Search::playRuns(const Chances &chances, uint64_t runs, Slot &slot) {
  History::setSuccessions(&board_->successions);
  while (!spent()) {
    const uint64_t run = board_->next++;
    if (run >= runs) return;
    slot.run = run;
    Crew::beginRun(true);
    const Case played = caseOf(chances, run);
    const Outcome outcome = play(played, playing_);
    if (chances.twice) requireEqual(outcome, play(played, playing_));
    count(*played.scenario, outcome, slot);
  }
}

std::optional<Found> Search::byChance(const Chances &chances, const Budget &budget) {
  begin(budget);
  for (const Scenario *scenario : chances.scenarios) openAccount(*scenario);
  for (unsigned member = 0; member < crew_.jobs(); ++member)
    crew_.start(member, [&, member] { playRuns(chances, budget.runs, board_->slots[member]); });
  const std::optional<Fallen> fallen = watch();
  if (!fallen) return std::nullopt;
  const uint64_t run = board_->slots[fallen->member].run;
  return Found{caseOf(chances, run), fallen->failure};
}

std::optional<Found> Search::measure(const std::vector<const Scenario *> &scenarios) {
  for (const Scenario *scenario : scenarios) {
    const Case played = makeCase(*scenario, 1, {}, length_);
    const auto failure = crew_.alone([&] { play(played, playing_, logs_[0].get()); });
    if (failure) return Found{played, *failure};
    lengths_[scenario] = std::bit_ceil(std::max(logs_[0]->choices(), 1u));
  }
  return std::nullopt;
}

/* ---- All schedules --------------------------------------------------------------------------- */

void Search::playSchedules(const Case &searched, uint32_t share, uint32_t preemptions) {
  History::setSuccessions(&board_->successions);
  Slot &slot = board_->slots[share];
  ScheduleLog &log = *logs_[share];
  for (uint32_t bound = 0; bound <= preemptions; ++bound) {
    BoundedSearch search(bound, share, crew_.jobs());
    do {
      if (spent()) return;
      Crew::beginRun(true);
      log.clear();
      Recorder recorder(search, log);
      const Outcome outcome =
          searched.scenario->play(searched.plan, {.seed = searched.seed,
                                                  .module = playing_.module,
                                                  .strategy = &recorder,
                                                  .historyLength = playing_.historyLength});
      count(*searched.scenario, outcome, slot);
      if (search.owned()) ++slot.schedules[bound];
    } while (search.advance());
    slot.complete[bound] = true;
  }
}

std::optional<Found> Search::exhaust(const Scenario &scenario, uint64_t seed, uint32_t preemptions,
                                     const Budget &budget) {
  preemptions = std::min(preemptions, mostPreemptions);
  begin(budget);
  openAccount(scenario);
  Case searched =
      makeCase(scenario, seed, {StrategyName::Kind::Exhaustive, preemptions, 0}, length_);
  for (unsigned member = 0; member < crew_.jobs(); ++member)
    crew_.start(member, [&, member] { playSchedules(searched, member, preemptions); });
  const std::optional<Fallen> fallen = watch();
  for (uint32_t bound = 0; bound <= preemptions; ++bound) {
    Exhausted result{scenario.name(), seed, bound, 0, true};
    for (unsigned member = 0; member < crew_.jobs(); ++member) {
      result.schedules += board_->slots[member].schedules[bound];
      result.complete &= board_->slots[member].complete[bound];
    }
    if (result.schedules > 0) exhausted_.push_back(result);
  }
  if (!fallen) return std::nullopt;
  searched.schedule = logs_[fallen->member]->schedule();
  return Found{searched, fallen->failure};
}

}  // namespace sim
