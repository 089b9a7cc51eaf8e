/* Medians, ratios and verdicts; see figures.h. */
#include "bench/figures.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <set>

#include "bench/registry.h"

namespace bench {

namespace {

/* The first round has found out how often a subject is to be repeated; the others save themselves that,
 * and do as much. */
void repeatAsOften(const Subject &subject, const benchmark::BenchmarkReporter::Run &run) {
  registry().benchmarks.at(subject)->Iterations(run.iterations / run.threads);
}

}  // namespace

void Figures::ReportRuns(const std::vector<Run> &runs) {
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
    nanoseconds_[subject].push_back(run.GetAdjustedRealTime() / divisor);
    if (nanoseconds_[subject].size() == 1) repeatAsOften(subject, run);
    for (const char *percentile : {P50, P99}) {
      const auto counter = run.counters.find(percentile);
      if (counter == run.counters.end()) continue;
      nanoseconds_[{subject.work + ", " + percentile, subject.who}].push_back(
          counter->second.value);
    }
  }
}

Figures::Figure Figures::figureOf(Rounds values) {
  if (values.empty()) return {};
  std::sort(values.begin(), values.end());
  const double median = values[values.size() / 2];
  const double spread = (values[values.size() * 3 / 4] - values[values.size() / 4]) / 2;
  return {median, median == 0 ? 0 : 100 * spread / median};
}

const Figures::Rounds *Figures::find(const Subject &subject) const {
  const auto found = nanoseconds_.find(subject);
  return found == nanoseconds_.end() ? nullptr : &found->second;
}

/* Not measured when any of what the bar names was not. */
Figures::Figure Figures::ratio(const Bar &bar, const Subject &peer) const {
  size_t rounds = SIZE_MAX;
  for (const auto &named : {std::vector{bar.ours, peer}, bar.baseline, bar.growth}) {
    for (const Subject &subject : named) {
      const Rounds *const measured = find(subject);
      rounds = std::min(rounds, measured == nullptr ? 0 : measured->size());
    }
  }
  Rounds ratios;
  for (size_t round = 0; round < rounds; round++) {
    const auto at = [&](const Subject &subject) { return (*find(subject))[round]; };
    const double less = bar.baseline.empty() ? 0 : at(bar.baseline.front());
    const double grown = bar.growth.empty() ? 1 : at(bar.growth.back()) / at(bar.growth.front());
    ratios.push_back((at(bar.ours) - less) / (at(peer) - less) / grown);
  }
  return figureOf(std::move(ratios));
}

/* Work by work, in the order in which it was first named, each followed by its percentiles. */
std::vector<Figures::Line> Figures::inOrder() const {
  std::vector<Line> ordered;
  std::set<std::string> done;
  for (const Subject &first : registry().subjects) {
    if (!done.insert(first.work).second) continue;
    for (const std::string suffix : {"", ", p50", ", p99"}) {
      for (const Subject &subject : registry().subjects) {
        if (subject.work != first.work) continue;
        const Subject named{subject.work + suffix, subject.who}, ours{named.work};
        const Rounds *const rounds = find(named);
        if (rounds == nullptr) continue;
        ordered.push_back({named, figureOf(*rounds), {}});
        if (named.who != OURS) ordered.back().ratio = ratio({"", ours, 0, {}}, named);
      }
    }
  }
  return ordered;
}

Figures::Verdict Figures::judge(const Bar &bar) const {
  Verdict verdict{bar.text, "", bar.most, {}};
  for (const Subject &peer : bar.peers) {
    const Figure got = ratio(bar, peer);
    if (std::isnan(got.median)) { /* the fastest cannot be named before all are known */
      verdict.got = {};
      return verdict;
    }
    if (verdict.measured() && got.median <= verdict.got.median) continue;
    verdict.got = got;
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
        {{count.text, "", static_cast<double>(count.most), {static_cast<double>(count.count)}},
         {}});
  }
  return all;
}

void Figures::print() const {
  std::printf("\n%-36s %-36s %11s %6s %9s %6s\n", "work", "who", "ns", "+-", "ours/this", "+-");
  std::string work;
  for (const auto &[subject, time, ratio] : inOrder()) {
    std::printf("%-36s %-36s %11.1f %5.1f%%", subject.work == work ? "" : subject.work.c_str(),
                subject.who.c_str(), time.median, time.spreadPercent);
    work = subject.work;
    if (!std::isnan(ratio.median)) std::printf(" %9.2f %5.1f%%", ratio.median, ratio.spreadPercent);
    std::printf("\n");
  }
  for (const auto &[subject, why] : registry().notMeasured) {
    std::printf("%-36s %-36s not measured: %s\n", subject.work.c_str(), subject.who.c_str(),
                why.c_str());
  }
  for (const Statement &said : registry().statements) {
    std::printf("%-73s %11.0f %s\n", said.text.c_str(), said.value, said.unit.c_str());
  }

  std::printf("\n%-8s %8s %8s %6s  %s\n", "bar", "at most", "is", "+-", "what is asked");
  size_t met = 0, measured = 0, atFloor = 0;
  const std::vector<Judged> all = verdicts();
  for (const auto &[bar, floor] : all) {
    if (!bar.measured()) continue;
    measured++;
    met += bar.met();
    const char *verdict = bar.met() ? "met" : "MISSED";
    if (bar.against.empty()) {
      std::printf("%-8s %8.0f %8.0f %6s  %s\n", verdict, bar.most, bar.got.median, "",
                  bar.text.c_str());
      continue;
    }
    std::printf("%-8s %8.2f %8.3f %5.1f%%  %s, against %s\n", verdict, bar.most, bar.got.median,
                bar.got.spreadPercent, bar.text.c_str(), bar.against.c_str());
    for (const Verdict &least : floor) {
      atFloor += least.met();
      std::printf("%-8s %8.2f %8.3f %5.1f%%    its floor: %s\n",
                  least.met() ? "  kept" : "  MISSED", least.most, least.got.median,
                  least.got.spreadPercent, least.against.c_str());
    }
  }
  std::printf("%zu of %zu measured bars are met; of the %zu others %zu keep to their floor\n", met,
              measured, measured - met, atFloor);
  if (measured != all.size()) std::printf("%zu bars were not measured\n", all.size() - measured);
}

nlohmann::ordered_json Figures::json() const {
  nlohmann::ordered_json all;
  for (const auto &[subject, time, ratio] : inOrder()) {
    auto &said =
        all["figures"].emplace_back(nlohmann::ordered_json{{"work", subject.work},
                                                           {"who", subject.who},
                                                           {"nanoseconds", time.median},
                                                           {"spread_percent", time.spreadPercent}});
    if (!std::isnan(ratio.median)) said["ours_to_this"] = ratio.median;
  }
  for (const auto &[subject, why] : registry().notMeasured) {
    all["not_measured"].push_back({{"work", subject.work}, {"who", subject.who}, {"why", why}});
  }
  const auto jsonOf = [](const Verdict &verdict) {
    return nlohmann::ordered_json{{"text", verdict.text},
                                  {"against", verdict.against},
                                  {"at_most", verdict.most},
                                  {"is", verdict.got.median},
                                  {"spread_percent", verdict.got.spreadPercent},
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
