/* Rounds, and groups of what is compared; see rounds.h. */
#include "bench/rounds.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <map>
#include <random>
#include <regex>
#include <vector>

#include "bench/registry.h"

namespace bench {
namespace {

/* The works that a bar compares. */
std::vector<std::string> worksOf(const Bar &bar) {
  std::vector<std::string> works;
  for (const auto &subjects : {std::vector{bar.ours}, bar.peers, bar.baseline, bar.growth}) {
    for (const Subject &subject : subjects) works.push_back(measuredWork(subject.work));
  }
  return works;
}

/* Of each work the number of its group: works that are compared, if only by way of others, have the
 * same. */
std::map<std::string, size_t> groupNumbers() {
  std::map<std::string, size_t> group;
  for (const Subject &subject : registry().subjects) group.emplace(subject.work, group.size());
  for (const auto &bars : {registry().bars, registry().floors}) {
    for (const Bar &bar : bars) {
      const std::vector<std::string> works = worksOf(bar);
      for (const std::string &work : works) {
        const size_t from = group.at(work), to = group.at(works.front());
        for (auto &[name, number] : group) number = number == from ? to : number;
      }
    }
  }
  return group;
}

/* Matches this text alone, in whichever of the usual grammars. */
std::string literally(const std::string &text) {
  std::string expression;
  for (const char c : text) {
    if (std::string("\\^$.|?*+()[]{}").find(c) != std::string::npos) expression += '\\';
    expression += c;
  }
  return expression;
}

/* For each group an expression that the names of its subjects match, as far as they are wanted. */
std::vector<std::string> groups(const std::string &filter) {
  const std::regex wanted(filter);
  const std::map<std::string, size_t> numbers = groupNumbers();
  std::map<size_t, std::string> names;
  for (const Subject &subject : registry().subjects) {
    const std::string name = nameOf(subject);
    if (!std::regex_search(name, wanted)) continue;
    std::string &group = names[numbers.at(subject.work)];
    group += (group.empty() ? "" : "|") + literally(name);
  }
  std::vector<std::string> expressions;
  for (const auto &[number, group] : names) expressions.push_back("^(" + group + ")(/|$)");
  return expressions;
}

/* A line on a terminal, once a second; gone at the end. */
class Progress {
 public:
  explicit Progress(size_t rounds) : rounds_(rounds) {}
  ~Progress() {
    if (shown_ != start_) std::fprintf(stderr, "\r\033[K");
  }
  Progress(const Progress &) = delete;
  Progress &operator=(const Progress &) = delete;

  void show(size_t round) {
    const Clock::time_point now = Clock::now();
    if (isatty(STDERR_FILENO) == 0 || now - shown_ < std::chrono::seconds(1)) return;
    shown_ = now;
    std::fprintf(stderr, "\rround %zu of %zu, %.0f s ", round, rounds_,
                 std::chrono::duration<double>(now - start_).count());
  }

 private:
  const size_t rounds_;
  const Clock::time_point start_ = Clock::now();
  Clock::time_point shown_ = start_;
};

}  // namespace

bool measureInRounds(size_t rounds, const std::string &filter, Figures &figures) {
  std::mt19937 random(std::random_device{}());
  std::vector<std::string> due = groups(filter);
  Progress progress(rounds);
  for (size_t round = 1; round <= rounds; round++) {
    std::shuffle(due.begin(), due.end(), random);
    for (const std::string &group : due) {
      benchmark::RunSpecifiedBenchmarks(&figures, group); /* in random order, says main */
      progress.show(round);
    }
  }
  return !due.empty();
}

}  // namespace bench
