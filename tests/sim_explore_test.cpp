/* The explorer's own promises: each strategy finds what it must, exhaustive search misses nothing and
 * repeats nothing, a failure is repeated, shortened and written down. The scenarios are toys whose
 * faults and schedules can be counted by hand.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "host/kernel/panic.h"
#include "platform/tolm.h"
#include "sim/explore/case.h"
#include "sim/explore/crew.h"
#include "sim/explore/explore.h"
#include "sim/simulation.h"

namespace {

using namespace std::chrono_literals;
using sim::Machine;
using testing::ContainsRegex;
using testing::HasSubstr;

/* ---- Toys ------------------------------------------------------------------------------------ */

/* A point at which others may go on. */
void point() {
  zel_GetTimerCycles();
}

/* A program of a few fibers. An operation does something when its `a` is 1; the faults never come. */
class Toy final : public sim::Scenario {
 public:
  using Body = void (*)(Machine &, const sim::Plan &);
  Toy(const char *name, Body body) : name_(name), body_(body) {}

  std::string name() const override { return name_; }
  std::string about() const override { return "a toy"; }
  bool small() const override { return true; }
  std::vector<std::string> actors() const override { return {"somebody"}; }
  sim::Plan plan(uint64_t seed, size_t length) const override {
    sim::Plan plan;
    sim::Random random(seed);
    for (size_t i = 0; i < length; ++i)
      plan.operations.push_back({.a = static_cast<uint8_t>(random.below(2))});
    plan.faults = {{sim::Call::zel_HeapCreate, 1000, 1}, {sim::Call::zel_HeapAllocWithRA, 7, 2}};
    return plan;
  }
  std::string describe(const sim::Operation &operation) const override {
    return operation.a == 1 ? "something" : "nothing";
  }
  sim::Outcome play(const sim::Plan &plan, const sim::Run &run) const override {
    Machine machine({.seed = run.seed, .historyLength = run.historyLength, .stepLimit = 10'000});
    machine.setStrategy(std::make_unique<sim::Borrowed>(*run.strategy));
    body_(machine, plan);
    machine.run();
    return {.steps = machine.steps(), .hash = machine.traceHash(), .operations = 1};
  }

 private:
  const char *name_;
  Body body_;
};

/* Two fibers count up one after the other's reading: one preemption between reading and writing
 * loses a count. */
void loseUpdate(Machine &machine, const sim::Plan &) {
  int counter = 0;
  for (const char *name : {"ann", "bob"}) {
    machine.spawn(name, [&] {
      point();
      const int read = counter;
      point();
      counter = read + 1;
      point();
    });
  }
  machine.run();
  if (counter != 2) host::panic("an update was lost: %d", counter);
}

/* Fails when the witness looks on in the middle of the third operation that does something, and in
 * another way when there are just two. */
void needThree(Machine &machine, const sim::Plan &plan) {
  if (std::count_if(plan.operations.begin(), plan.operations.end(),
                    [](const sim::Operation &one) { return one.a == 1; }) == 2)
    host::panic("only two operations");
  int done = 0;
  bool halfway = false;
  machine.spawn("worker", [&] {
    for (const sim::Operation &operation : plan.operations) {
      point();
      if (operation.a != 1) continue;
      machine.note("operation:", sim::Argument::text("something"));
      halfway = true;
      point();
      halfway = false;
      ++done;
    }
  });
  machine.spawn("witness", [&] {
    for (int i = 0; i < 4; ++i) {
      point();
      if (halfway && done >= 2) host::panic("three operations, the last one halfway: %d", done);
    }
  });
  machine.run();
}

/* Ann passes two points and Bob one. */
void passPoints(Machine &machine, const sim::Plan &) {
  machine.spawn("ann", [] { point(), point(); });
  machine.spawn("bob", [] { point(); });
}

/* What is left to chance beside the order: here, who is to be told of something. */
void chooseFreely(Machine &machine, const sim::Plan &) {
  for (const char *name : {"ann", "bob"})
    machine.spawn(name, [&] { point(), machine.scheduler().pick(3), point(); });
}

/* Takes another course each time. */
void drift(Machine &machine, const sim::Plan &) {
  static int runs = 0;
  machine.spawn("ann", [] {
    for (int i = 0; i < runs; ++i) point();
  });
  ++runs;
}

/* ---- The command ----------------------------------------------------------------------------- */

struct Answer {
  int status;
  std::string text;

  /* The options that play again what was found. */
  std::string again() const {
    const std::string mark = "Again:   toys ";
    const size_t begin = text.find(mark) + mark.size();
    return text.substr(begin, text.find('\n', begin) - begin);
  }
};

Answer command(const std::string &options) {
  std::vector<std::unique_ptr<sim::Scenario>> scenarios;
  scenarios.push_back(std::make_unique<Toy>("lost-update", &loseUpdate));
  scenarios.push_back(std::make_unique<Toy>("points", &passPoints));
  scenarios.push_back(std::make_unique<Toy>("three", &needThree));
  scenarios.push_back(std::make_unique<Toy>("drift", &drift));
  std::vector<std::string> words = {"toys"};
  std::istringstream stream(options);
  for (std::string word; stream >> word;) words.push_back(word);
  std::vector<char *> arguments;
  for (std::string &word : words) arguments.push_back(word.data());
  testing::internal::CaptureStdout();
  testing::internal::CaptureStderr();
  const int status =
      sim::explore(static_cast<int>(arguments.size()), arguments.data(), scenarios,
                   {.program = "toys", .watched = "watched.so", .plain = "sim_explore_test"});
  const std::string errors = testing::internal::GetCapturedStderr();
  return {status, testing::internal::GetCapturedStdout() + errors};
}

/* By the numbers that are printed each fails again. Without a change of priorities, or a preemption,
 * two fibers follow each other whole, and nothing is lost. */
TEST(Strategy, FindsAFaultWithinSoManyRunsAndRepeatsIt) {
  const std::string options = "--scenario lost-update --runs 200 --shorten-runs 0 --strategy ";
  for (const std::string strategy : {"random", "random:3", "pct:2", "exhaustive:1"}) {
    const Answer found = command(options + strategy);
    EXPECT_EQ(found.status, 1) << strategy;
    EXPECT_THAT(found.text, HasSubstr("Found: an update was lost: 1"));
    EXPECT_THAT(command(found.again()).text, HasSubstr("Failure: an update was lost: 1"));
  }
  EXPECT_EQ(command(options + "exhaustive:0").status, 0);
  const Answer whole = command(options + "pct:1");
  EXPECT_EQ(whole.status, 0);
  EXPECT_THAT(whole.text, HasSubstr("200 runs of 1 scenarios"));
  EXPECT_THAT(whole.text, HasSubstr("about 2 different ones"));
}

/* Ann's three stretches and Bob's two: of the ten orders, 2 need no preemption, 3 one, 4 two, 1
 * three. */
TEST(Exhaustive, PlaysEveryScheduleOnceWhoeverSharesTheWorkAndSaysWhatItHadNoBudgetFor) {
  const std::string bounds =
      "  points, seed 1, at most 0 preemptions: 2 schedules, which are all\n"
      "  points, seed 1, at most 1 preemptions: 5 schedules, which are all\n"
      "  points, seed 1, at most 2 preemptions: ";
  for (const std::string jobs : {"1", "2", "3"})
    EXPECT_THAT(command("--scenario points --strategy exhaustive:3 --jobs " + jobs).text,
                HasSubstr(bounds + "9 schedules, which are all\n  points, seed 1, at most 3 "
                                   "preemptions: 10 schedules, which are all\n"));
  EXPECT_THAT(command("--scenario points --strategy exhaustive:3 --jobs 1 --runs 10").text,
              HasSubstr(bounds + "3 schedules, not all\n"));
}

TEST(Replay, TakesTheSameCourseFromTheDeviationsAlone) {
  const Toy toy("choices", &chooseFreely);
  std::set<uint64_t> courses;
  for (uint64_t seed = 1; seed <= 40; ++seed) {
    sim::ScheduleLog log;
    sim::Case played = sim::makeCase(toy, seed, sim::StrategyName::parse("random"), 0);
    const sim::Outcome first = sim::play(played, {}, &log);
    played.schedule = log.schedule();
    EXPECT_EQ(sim::play(played, {}).hash, first.hash) << "seed " << seed;
    courses.insert(first.hash);
  }
  EXPECT_GT(courses.size(), 20u);
}

TEST(Crew, ReportsWhatNeverEndsAndWhatCrashes) {
  const auto failureOf = [](void (*work)(), std::chrono::milliseconds patience) {
    sim::Crew crew(1, patience);
    const auto failure = crew.alone([&] { Machine().call("ann", work); });
    return failure ? failure->message : "none";
  };
  const auto circles = [] {
    for (volatile bool forever = true; forever;) {
    }
  };
  EXPECT_THAT(failureOf(circles, 200ms), HasSubstr("no step within 0 seconds"));
  EXPECT_THAT(failureOf([] { raise(SIGSEGV); }, 60s), ContainsRegex("Segmentation fault|SEGV"));
}

/* The least that fails are three operations, no fault and one preemption. On the way there many plans
 * with two fail, in another way. */
TEST(Command, FindsShortensAndRepeats) {
  const Answer found = command(
      "--scenario three --strategy random --runs 500 --length 20 --shorten-runs 3000 --seed 3");
  EXPECT_EQ(found.status, 1);
  EXPECT_THAT(found.text,
              testing::AllOf(HasSubstr("Found: three operations, the last one halfway: "),
                             HasSubstr("phase 0   somebody         something\n"),
                             ContainsRegex("worker +zel_GetTimerCycles"),
                             HasSubstr("* operation: something\n")));
  EXPECT_THAT(found.again(),
              ContainsRegex("--scenario three --seed [0-9]+ --operations 000000010000.000000010000."
                            "000000010000 --schedule [0-9]+:[0-9]+$"));
  EXPECT_EQ(command(found.again()).status, 1);
}

TEST(Command, TellsRunsThatDifferFromRunsThatDoNot) {
  EXPECT_EQ(command("--scenario points --check-determinism 50").status, 0);
  const Answer drifting = command("--scenario drift --check-determinism 50 --jobs 1");
  EXPECT_EQ(drifting.status, 1);
  EXPECT_THAT(drifting.text, HasSubstr("two runs of one seed differ: 1 steps and 2, "));
}

}  // namespace
