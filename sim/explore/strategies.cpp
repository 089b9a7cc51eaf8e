/* How the schedules are decided, noted and repeated. One OS thread, no lock. */
#include "sim/explore/strategies.h"

#include <algorithm>
#include <charconv>
#include <stdexcept>

#include "host/kernel/panic.h"
#include "sim/fiber.h"

namespace sim {

namespace {

Fiber &defaultOf(std::span<Fiber *const> runnable, Fiber *current) {
  return current ? *current : *runnable.front();
}

}  // namespace

/* ---- Writing down and playing again ---------------------------------------------------------- */

Schedule ScheduleLog::schedule() const {
  return {data_->deviations, data_->deviations + std::min(data_->count, capacity)};
}

void Recorder::note(bool deviates, uint64_t answer) {
  if (deviates) log_.add({log_.choices(), static_cast<uint32_t>(answer)});
  log_.passed();
}

Fiber &Recorder::next(std::span<Fiber *const> runnable, Fiber *current) {
  Fiber &chosen = decides_.next(runnable, current);
  if (runnable.size() > 1) note(&chosen != &defaultOf(runnable, current), chosen.id());
  return chosen;
}

size_t Recorder::pick(size_t count) {
  const size_t value = decides_.pick(count);
  if (count > 1) note(value != 0, value);
  return value;
}

const Deviation *Replay::due() {
  const uint32_t choice = choice_++;
  if (place_ == schedule_.size() || schedule_[place_].choice != choice) return nullptr;
  return &schedule_[place_++];
}

Fiber &Replay::next(std::span<Fiber *const> runnable, Fiber *current) {
  if (runnable.size() == 1) return *runnable.front();
  if (const Deviation *deviation = due()) {
    for (Fiber *fiber : runnable)
      if (fiber->id() == deviation->answer) return *fiber;
  }
  return defaultOf(runnable, current);
}

size_t Replay::pick(size_t count) {
  if (count == 1) return 0;
  const Deviation *deviation = due();
  return deviation && deviation->answer < count ? deviation->answer : 0;
}

/* ---- Priorities ------------------------------------------------------------------------------ */

namespace {

constexpr uint64_t firstPriority = uint64_t{1} << 63; /* the lowest of a fiber that never fell */
constexpr uint64_t firstFallen = uint64_t{1} << 62;   /* the lowest of one that fell by chance */
constexpr uint32_t leastPatience = 10'000;

}  // namespace

Pct::Pct(uint64_t seed, uint32_t depth, uint32_t length)
    : random_(seed), floor_(firstFallen), patience_(std::max(length, leastPatience)) {
  for (uint32_t change = 1; change < depth; ++change)
    changes_.push_back({static_cast<uint32_t>(random_.below(length)), firstFallen + change});
  std::sort(changes_.begin(), changes_.end(),
            [](const Change &a, const Change &b) { return a.choice > b.choice; });
}

/* Inline, as it is asked for each fiber at each step. */
inline uint64_t &Pct::priorityOf(const Fiber &fiber) {
  if (fiber.id() >= priorities_.size()) priorities_.resize(fiber.id() + 1);
  uint64_t &priority = priorities_[fiber.id()];
  if (priority == 0) priority = random_.next() | firstPriority;
  return priority;
}

inline Fiber &Pct::highest(std::span<Fiber *const> runnable) {
  Fiber *best = runnable.front();
  uint64_t most = priorityOf(*best);
  for (Fiber *fiber : runnable.subspan(1)) {
    const uint64_t priority = priorityOf(*fiber);
    if (priority <= most) continue;
    most = priority;
    best = fiber;
  }
  return *best;
}

Fiber &Pct::next(std::span<Fiber *const> runnable, Fiber *) {
  if (runnable.size() == 1) return *runnable.front();
  const uint32_t choice = choice_++;
  Fiber *chosen = &highest(runnable);
  while (!changes_.empty() && changes_.back().choice == choice) {
    priorityOf(*chosen) = changes_.back().priority;
    changes_.pop_back();
    chosen = &highest(runnable);
  }
  streak_ = streakOf_ == chosen->id() ? streak_ + 1 : 0;
  streakOf_ = chosen->id();
  if (streak_ < patience_) return *chosen;
  priorityOf(*chosen) = --floor_;
  return highest(runnable);
}

/* ---- All schedules within a bound ------------------------------------------------------------ */

BoundedSearch::BoundedSearch(uint32_t preemptions, uint32_t share, uint32_t shares)
    : bound_(preemptions), share_(share), shares_(shares) {}

uint32_t BoundedSearch::decide(uint32_t answers, bool preempts) {
  const uint32_t number = choice_++;
  if (passed_ == path_.size()) {
    if (preempts && preemptions_ == bound_) return 0;
    path_.push_back({number, answers, 0, preempts});
  } else if (path_[passed_].number != number) {
    return 0;
  }
  const Choice &choice = path_[passed_++];
  if (choice.answers != answers || choice.preempts != preempts)
    host::panic("the same choices led elsewhere: at choice %u there were %u answers, now %u",
                number, choice.answers, answers);
  if (choice.preempts && choice.taken > 0) ++preemptions_;
  return choice.taken;
}

Fiber &BoundedSearch::next(std::span<Fiber *const> runnable, Fiber *current) {
  Fiber &usual = defaultOf(runnable, current);
  if (runnable.size() == 1) return usual;
  uint32_t answer = decide(static_cast<uint32_t>(runnable.size()), current != nullptr);
  if (answer == 0) return usual;
  for (Fiber *fiber : runnable)
    if (fiber != &usual && --answer == 0) return *fiber;
  host::panic("a fiber was chosen that is not there");
}

size_t BoundedSearch::pick(size_t count) {
  return count == 1 ? 0 : decide(static_cast<uint32_t>(count), false);
}

/* A schedule's first deviation says whose it is. */
bool BoundedSearch::mayTake(const Choice &choice, bool first) const {
  return !first || (choice.number + choice.taken) % shares_ == share_;
}

bool BoundedSearch::advance() {
  passed_ = choice_ = preemptions_ = 0;
  for (; !path_.empty(); path_.pop_back()) {
    Choice &last = path_.back();
    const bool first = std::all_of(path_.begin(), path_.end() - 1,
                                   [](const Choice &choice) { return choice.taken == 0; });
    for (++last.taken; last.taken < last.answers; ++last.taken) {
      if (!mayTake(last, first)) continue;
      deviating_ = true;
      return true;
    }
  }
  return false;
}

/* ---- Names ----------------------------------------------------------------------------------- */

namespace {

[[noreturn]] void refuse(const std::string &text) {
  throw std::invalid_argument(
      "\"" + text +
      "\" is no strategy; write default, random[:N], pct[:DEPTH[:LENGTH]] or "
      "exhaustive[:PREEMPTIONS]");
}

/* The numbers behind the colons of a name. */
std::vector<uint32_t> numbersOf(const std::string &text) {
  std::vector<uint32_t> numbers;
  const char *const end = text.data() + text.size();
  for (size_t colon = text.find(':'); colon != std::string::npos;) {
    const size_t after = text.find(':', colon + 1);
    const char *const last = after == std::string::npos ? end : text.data() + after;
    uint32_t number = 0;
    const auto [stop, error] = std::from_chars(text.data() + colon + 1, last, number);
    if (error != std::errc() || stop != last) refuse(text);
    numbers.push_back(number);
    colon = after;
  }
  return numbers;
}

}  // namespace

std::string StrategyName::toString() const {
  const std::string number = std::to_string(parameter);
  switch (kind) {
    case Kind::Default:
      return "default";
    case Kind::Random:
      return parameter == 1 ? "random" : "random:" + number;
    case Kind::Pct:
      return "pct:" + number + (length == 0 ? "" : ":" + std::to_string(length));
    case Kind::Exhaustive:
      return "exhaustive:" + number;
  }
  return "";
}

StrategyName StrategyName::parse(const std::string &text) {
  const std::string word = text.substr(0, text.find(':'));
  const std::vector<uint32_t> numbers = numbersOf(text);
  const auto number = [&](size_t i, uint32_t usual) {
    return i < numbers.size() ? numbers[i] : usual;
  };
  StrategyName name;
  size_t most = 1;
  if (word == "default") {
    most = 0;
  } else if (word == "random") {
    name = {Kind::Random, number(0, 1), 0};
  } else if (word == "pct") {
    name = {Kind::Pct, number(0, 3), number(1, 0)};
    most = 2;
  } else if (word == "exhaustive") {
    name = {Kind::Exhaustive, number(0, 2), 0};
  } else {
    refuse(text);
  }
  const bool mayBeZero = name.kind == Kind::Exhaustive;
  if (numbers.size() > most || (name.parameter == 0 && !mayBeZero)) refuse(text);
  return name;
}

bool StrategyName::isOneRun() const {
  return kind != Kind::Exhaustive && (kind != Kind::Pct || length > 0);
}

std::unique_ptr<Strategy> StrategyName::make(uint64_t seed) const {
  if (!isOneRun()) host::panic("%s is not one run", toString().c_str());
  /* Another chance than the plan's, which comes from the same seed. */
  const uint64_t own = Random(~seed).next();
  if (kind == Kind::Default) return std::make_unique<RunOn>();
  if (kind == Kind::Random) return std::make_unique<RandomWalk>(own, parameter);
  return std::make_unique<Pct>(own, parameter, length);
}

}  // namespace sim
