/* Leaving out halves, quarters, ..., single items, as long as the same failure comes. Candidates are
 * played by all children at once. One thread.
 */
#include "sim/explore/shorten.h"

#include <algorithm>
#include <array>
#include <atomic>

#include "host/kernel/text.h"

namespace sim {

namespace {

constexpr size_t schedulesForPlan = 24; /* that are tried for a plan with something left out */
constexpr size_t schedulesARound = 150; /* that are tried for fewer deviations, */
constexpr size_t rounds = 8;            /* so many times */

std::vector<Operation> &operationsOf(Case &changed) {
  return changed.plan.operations;
}
std::vector<PlannedFault> &faultsOf(Case &changed) {
  return changed.plan.faults;
}
std::vector<Deviation> &deviationsOf(Case &changed) {
  return *changed.schedule;
}

}  // namespace

Shortener::Shortener(Crew &crew, const Playing &playing, const Limits &limits,
                     std::function<void(const std::string &)> progress)
    : crew_(crew),
      playing_(playing),
      limits_(limits),
      progress_(std::move(progress)),
      began_(std::chrono::steady_clock::now()) {}

bool Shortener::exhausted() const {
  return crew_.interrupted() || runs_ >= limits_.runs ||
         std::chrono::steady_clock::now() - began_ >= limits_.time;
}

void Shortener::tell(const Case &best) const {
  progress_(host::formatText("%zu operations, %zu faults, %zu deviations; %llu runs",
                             best.plan.operations.size(), best.plan.faults.size(),
                             best.schedule->size(), static_cast<unsigned long long>(runs_)));
}

/* ---- Playing --------------------------------------------------------------------------------- */

/* The lowest number whose case fails as it must; runs of higher numbers may be saved. */
std::optional<size_t> Shortener::firstFailure(size_t count, const Attempt &attempt) {
  struct Board {
    std::atomic<size_t> next, end, played;
    std::array<std::atomic<size_t>, 256> current;
  };
  const Shared<Board> board;
  board->end = std::min<size_t>(count, limits_.runs - std::min(runs_, limits_.runs));
  const auto work = [&](unsigned member) {
    for (size_t number; !exhausted() && (number = board->next++) < board->end;) {
      board->current[member] = number;
      ++board->played;
      Crew::beginRun();
      play(attempt(number), playing_);
    }
  };
  const auto start = [&](unsigned member) { crew_.start(member, [=] { work(member); }); };
  for (unsigned member = 0; member < std::min<size_t>(crew_.jobs(), count); ++member) start(member);

  std::optional<size_t> first;
  while (crew_.busy() && !crew_.interrupted()) {
    const std::optional<Crew::Ending> ending = crew_.wait(std::chrono::seconds(1));
    if (!ending || !ending->failure) continue;
    const size_t number = board->current[ending->member];
    if (ending->failure->kind() != kind_) {
      start(ending->member);
    } else if (!first || number < *first) {
      first = number;
      board->end = number;
    }
  }
  crew_.stop();
  runs_ += board->played;
  return first;
}

/* The case with the schedule that it took, if it fails as it must. */
std::optional<Case> Shortener::recorded(const Case &played) {
  ++runs_;
  const auto failure = crew_.alone([&] { play(played, playing_, &log_); });
  if (!failure || failure->kind() != kind_ || !log_.complete()) return std::nullopt;
  Case fixed = played;
  fixed.schedule = log_.schedule();
  return fixed;
}

std::optional<Case> Shortener::fix(const Found &found) {
  kind_ = found.failure.kind();
  return recorded(found.failing);
}

/* ---- Leaving out ----------------------------------------------------------------------------- */

/* Takes over the first of the cases that fails, with the schedule that it took. */
bool Shortener::tryAll(Case &best, size_t count, const Attempt &attempt) {
  const std::optional<size_t> number = firstFailure(count, attempt);
  if (!number) return false;
  std::optional<Case> better = recorded(attempt(*number));
  if (!better) return false;
  best = std::move(*better);
  tell(best);
  return true;
}

namespace {

/* The plan by priorities, which deviate little. */
Case byPriorities(Case changed, uint32_t depth, uint64_t seed) {
  const size_t choices = changed.schedule->empty() ? 0 : changed.schedule->back().choice;
  const auto length = static_cast<uint32_t>(std::max<size_t>(choices * 5 / 4, 16));
  changed.schedule.reset();
  changed.strategy = {StrategyName::Kind::Pct, depth, length};
  changed.strategySeed = seed;
  return changed;
}

/* The schedule as it was found first, then those of the strategy that found it and of priorities. */
Case otherSchedule(Case changed, size_t number) {
  if (number == 0) return changed;
  constexpr uint32_t depths[] = {2, 3, 3, 1};
  const uint64_t seed = changed.seed + number / 4;
  if (number % 4 != 1 || !changed.strategy.isOneRun())
    return byPriorities(std::move(changed), depths[number % 4], seed);
  changed.schedule.reset();
  changed.strategySeed = seed;
  return changed;
}

}  // namespace

/* `schedules` of each candidate are tried. */
template <typename Item>
bool Shortener::leaveOut(Case &best, std::vector<Item> &(*items)(Case &), size_t schedules) {
  bool shorter = false;
  size_t chunk = std::max<size_t>(items(best).size() / 2, 1);
  while (!items(best).empty() && !exhausted()) {
    const size_t size = items(best).size();
    chunk = std::min(chunk, size);
    const size_t candidates = (size + chunk - 1) / chunk;
    /* Later parts first: what follows the fault itself is the likeliest to be of no use. */
    const auto attempt = [&](size_t number) {
      Case candidate = best;
      const size_t begin = (candidates - 1 - number % candidates) * chunk;
      const size_t end = std::min(begin + chunk, size);
      std::vector<Item> &kept = items(candidate);
      kept.erase(kept.begin() + static_cast<ptrdiff_t>(begin),
                 kept.begin() + static_cast<ptrdiff_t>(end));
      return otherSchedule(std::move(candidate), number / candidates);
    };
    if (tryAll(best, candidates * schedules, attempt)) {
      shorter = true;
    } else if (chunk == 1) {
      break;
    } else {
      chunk /= 2;
    }
  }
  return shorter;
}

/* The same plan by another schedule, if that needs fewer deviations: what is left of one when nothing
 * more can be left out depends on where it came from. */
void Shortener::simplerSchedule(Case &best) {
  for (size_t round = 0; round < rounds && best.schedule->size() > 1 && !exhausted(); ++round) {
    Case other = best;
    const auto attempt = [round, original = best](size_t number) {
      const uint32_t depth = 1 + static_cast<uint32_t>(3 * number / schedulesARound);
      return byPriorities(original, depth, original.seed + round * schedulesARound + number);
    };
    if (!tryAll(other, schedulesARound, attempt)) return;
    leaveOut(other, &deviationsOf, 1);
    if (other.schedule->size() < best.schedule->size()) best = other;
  }
}

Case Shortener::shorten(Case fixed) {
  tell(fixed);
  for (bool shorter = true; shorter && !exhausted();) {
    shorter = leaveOut(fixed, &operationsOf, schedulesForPlan);
    shorter |= leaveOut(fixed, &faultsOf, schedulesForPlan);
    shorter |= leaveOut(fixed, &deviationsOf, 1);
    simplerSchedule(fixed);
  }
  return fixed;
}

}  // namespace sim
