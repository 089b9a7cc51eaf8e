/* Medians, ratios and verdicts; see figures.h. */
#include "bench/figures.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <set>

#include "bench/registry.h"

namespace bench {

void Figures::ReportRuns(const std::vector<Run> &runs) {
  std::map<Subject, std::vector<double>> values;
  for (const Run &run : runs) {
    if (run.error_occurred) {
      std::fprintf(stderr, "%s: %s\n", run.benchmark_name().c_str(), run.error_message.c_str());
      failed_ = true;
      return;
    }
    if (run.run_type != Run::RT_Iteration) continue;
    const Subject subject = subjectOf(run.run_name.function_name);
    const auto items = run.counters.find(ITEMS);
    const double divisor = items == run.counters.end() ? 1 : items->second.value;
    values[subject].push_back(run.GetAdjustedRealTime() / divisor);
    for (const char *percentile : {P50, P99}) {
      const auto counter = run.counters.find(percentile);
      if (counter == run.counters.end()) continue;
      values[{subject.work + ", " + percentile, subject.who}].push_back(counter->second.value);
    }
  }
  for (auto &[subject, times] : values) {
    std::sort(times.begin(), times.end());
    const double median = times[times.size() / 2];
    const double spread = (times[times.size() * 3 / 4] - times[times.size() / 4]) / 2;
    figures_[subject] = {median, 100 * spread / median};
  }
}

const Figures::Figure *Figures::find(const Subject &subject) const {
  const auto found = figures_.find(subject);
  return found == figures_.end() ? nullptr : &found->second;
}

/* Work by work, in the order in which it was first named, each followed by its percentiles. */
std::vector<std::pair<Subject, Figures::Figure>> Figures::inOrder() const {
  std::vector<std::pair<Subject, Figure>> ordered;
  std::set<std::string> done;
  for (const Subject &first : registry().subjects) {
    if (!done.insert(first.work).second) continue;
    for (const std::string suffix : {"", ", p50", ", p99"}) {
      for (const Subject &subject : registry().subjects) {
        if (subject.work != first.work) continue;
        const Subject named{subject.work + suffix, subject.who};
        if (const Figure *figure = find(named)) ordered.emplace_back(named, *figure);
      }
    }
  }
  return ordered;
}

Figures::Verdict Figures::judge(const Bar &bar) const {
  Verdict verdict{bar.text, "", bar.most, NAN};
  const Figure *ours = find(bar.ours);
  const Figure *base = bar.baseline.empty() ? nullptr : find(bar.baseline.front());
  if (ours == nullptr || (base == nullptr && !bar.baseline.empty())) return verdict;
  const double less = base == nullptr ? 0 : base->nanoseconds;
  for (const Subject &peer : bar.peers) {
    const Figure *figure = find(peer);
    if (figure == nullptr) { /* the fastest cannot be named before all are known */
      verdict.got = NAN;
      return verdict;
    }
    double ratio = (ours->nanoseconds - less) / (figure->nanoseconds - less);
    if (!bar.growth.empty()) {
      const Figure *first = find(bar.growth.front()), *second = find(bar.growth.back());
      ratio *=
          first == nullptr || second == nullptr ? NAN : first->nanoseconds / second->nanoseconds;
    }
    if (verdict.measured() && ratio <= verdict.got) continue;
    verdict.got = ratio;
    verdict.against = peer.work == bar.ours.work ? peer.who : peer.work + ", " + peer.who;
    if (!bar.growth.empty()) verdict.against = "the growth of " + bar.growth.front().who;
  }
  return verdict;
}

std::vector<Figures::Judged> Figures::verdicts() const {
  std::vector<Judged> all;
  for (const Bar &bar : registry().bars) {
    Judged &judged = all.emplace_back(judge(bar));
    if (!judged.bar.measured() || judged.bar.met()) continue;
    for (const Bar &floor : registry().floors) {
      if (floor.text != bar.text) continue;
      const Verdict least = judge(floor);
      if (least.measured()) judged.floor = {least};
    }
  }
  for (const Count &count : registry().counts) {
    all.push_back(
        {{count.text, "", static_cast<double>(count.most), static_cast<double>(count.count)}, {}});
  }
  return all;
}

void Figures::print() const {
  const auto figures = inOrder();
  std::printf("\n%-36s %-36s %11s %6s %9s\n", "work", "who", "ns", "+-", "ours/this");
  std::string work;
  for (const auto &[subject, figure] : figures) {
    const Figure *ours = find({subject.work});
    std::printf("%-36s %-36s %11.1f %5.1f%%", subject.work == work ? "" : subject.work.c_str(),
                subject.who.c_str(), figure.nanoseconds, figure.spreadPercent);
    work = subject.work;
    if (ours != nullptr && subject.who != OURS) {
      std::printf(" %9.2f", ours->nanoseconds / figure.nanoseconds);
    }
    std::printf("\n");
  }
  for (const auto &[subject, why] : registry().notMeasured) {
    std::printf("%-36s %-36s not measured: %s\n", subject.work.c_str(), subject.who.c_str(),
                why.c_str());
  }
  for (const Statement &said : registry().statements) {
    std::printf("%-73s %11.0f %s\n", said.text.c_str(), said.value, said.unit.c_str());
  }

  std::printf("\n%-8s %8s %8s  %s\n", "bar", "at most", "is", "what is asked");
  size_t met = 0, measured = 0, atFloor = 0;
  for (const auto &[bar, floor] : verdicts()) {
    met += bar.met();
    measured += bar.measured();
    std::printf("%-8s %8.2f %8.2f  %s%s%s\n",
                !bar.measured() ? "not run"
                : bar.met()     ? "met"
                                : "MISSED",
                bar.most, bar.got, bar.text.c_str(), bar.against.empty() ? "" : ", against ",
                bar.against.c_str());
    for (const Verdict &least : floor) {
      atFloor += least.met();
      std::printf("%-8s %8.2f %8.2f    its floor: %s\n", least.met() ? "  kept" : "  MISSED",
                  least.most, least.got, least.against.c_str());
    }
  }
  std::printf("%zu of %zu measured bars are met; of the %zu others %zu keep to their floor\n", met,
              measured, measured - met, atFloor);
}

nlohmann::ordered_json Figures::json() const {
  nlohmann::ordered_json all;
  for (const auto &[subject, figure] : inOrder()) {
    all["figures"].push_back({{"work", subject.work},
                              {"who", subject.who},
                              {"nanoseconds", figure.nanoseconds},
                              {"spread_percent", figure.spreadPercent}});
  }
  for (const auto &[subject, why] : registry().notMeasured) {
    all["not_measured"].push_back({{"work", subject.work}, {"who", subject.who}, {"why", why}});
  }
  const auto jsonOf = [](const Verdict &verdict) {
    return nlohmann::ordered_json{{"text", verdict.text},
                                  {"against", verdict.against},
                                  {"at_most", verdict.most},
                                  {"is", verdict.got},
                                  {"met", verdict.met()}};
  };
  for (const auto &[bar, floor] : verdicts()) {
    if (!bar.measured()) continue;
    auto &said = all["bars"].emplace_back(jsonOf(bar));
    if (!floor.empty()) said["floor"] = jsonOf(floor.front());
  }
  for (const Statement &said : registry().statements) {
    all["statements"].push_back({{"text", said.text}, {"value", said.value}, {"unit", said.unit}});
  }
  return all;
}

}  // namespace bench
