/* Names, bars and processors; see bench.h. */
#include "bench/bench.h"

#include <sched.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <stdexcept>

#include "bench/registry.h"

namespace bench {
namespace {

const std::string SEPARATOR = " | ";

/* The processors that this program may use, as they were at its start. */
cpu_set_t processorsAtHand() {
  cpu_set_t processors;
  if (sched_getaffinity(0, sizeof processors, &processors) != 0) {
    throw std::runtime_error("which processors are at hand cannot be told");
  }
  return processors;
}
const cpu_set_t atHand = processorsAtHand();

/* The set of one processor. */
cpu_set_t one(unsigned processor) {
  unsigned skip = processor % static_cast<unsigned>(CPU_COUNT(&atHand));
  int number = 0;
  while (!CPU_ISSET(number, &atHand) || skip-- != 0) number++;
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(number, &set);
  return set;
}

/* 0: the calling thread. False when there is no such thread. */
bool runOn(pid_t thread, const cpu_set_t &processors) {
  if (sched_setaffinity(thread, sizeof processors, &processors) == 0) return true;
  if (errno == ESRCH) return false;
  throw std::runtime_error("a thread cannot be bound to its processor");
}

void runOthersOn(const cpu_set_t &processors) {
  for (const auto &task : std::filesystem::directory_iterator("/proc/self/task")) {
    const pid_t thread = std::stoi(task.path().filename());
    if (thread != gettid()) runOn(thread, processors);
  }
}

template <typename Said>
Said *already(std::vector<Said> &said, const std::string &text) {
  const auto found =
      std::find_if(said.begin(), said.end(), [&](const Said &one) { return one.text == text; });
  return found == said.end() ? nullptr : &*found;
}

}  // namespace

Registry &registry() {
  static Registry registry;
  return registry;
}

std::string nameOf(const Subject &subject) {
  return subject.work + SEPARATOR + subject.who;
}

benchmark::internal::Benchmark *add(const Subject &subject,
                                    benchmark::internal::Benchmark *measured) {
  registry().subjects.push_back(subject);
  registry().benchmarks[subject] = measured;
  return measured;
}

Subject subjectOf(const std::string &name) {
  const size_t end = name.find(SEPARATOR);
  return {name.substr(0, end), name.substr(end + SEPARATOR.size())};
}

std::string measuredWork(const std::string &work) {
  for (const char *percentile : {P50, P99}) {
    const std::string suffix = std::string(", ") + percentile;
    if (work.ends_with(suffix)) return work.substr(0, work.size() - suffix.size());
  }
  return work;
}

void notMeasured(const Subject &subject, const std::string &why) {
  registry().notMeasured[subject] = why;
}

void percentiles(benchmark::State &state, std::vector<double> &nanoseconds) {
  std::sort(nanoseconds.begin(), nanoseconds.end());
  state.counters[P50] = nanoseconds[nanoseconds.size() / 2];
  state.counters[P99] = nanoseconds[nanoseconds.size() * 99 / 100];
}

void ask(const Bar &bar) {
  registry().bars.push_back(bar);
}

void ask(const std::string &work, double most, const std::vector<std::string> &peers) {
  Bar bar{work, {work}, most, {}};
  for (const std::string &peer : peers) bar.peers.push_back({work, peer});
  ask(bar);
}

void nameFloor(Bar bar) {
  bar.most = AT_FLOOR;
  registry().floors.push_back(std::move(bar));
}

void nameFloor(const std::string &work, const std::string &limit) {
  nameFloor({work, {work}, AT_FLOOR, {{work, limit}}});
}

void askCount(const std::string &text, uint64_t count, uint64_t most) {
  if (Count *said = already(registry().counts, text)) {
    said->count = std::max(said->count, count);
  } else {
    registry().counts.push_back({text, count, most});
  }
}

void state(const std::string &text, double value, const std::string &unit) {
  if (already(registry().statements, text) == nullptr) {
    registry().statements.push_back({text, value, unit});
  }
}

void pin(unsigned processor) {
  runOn(0, one(processor));
}

void unpin() {
  runOn(0, atHand);
}

OthersPinned::OthersPinned(unsigned processor) {
  runOthersOn(one(processor));
}

OthersPinned::~OthersPinned() {
  runOthersOn(atHand);
}

}  // namespace bench
