/* The explorer's own promises: each strategy finds what it must, exhaustive search misses nothing and
 * repeats nothing, a failure is repeated, shortened and written down. The scenarios are toys whose
 * faults and schedules can be counted by hand.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "host/kernel/panic.h"
#include "host/threads/sync.h"
#include "platform/tolm.h"
#include "sim/explore/case.h"
#include "sim/explore/crew.h"
#include "sim/explore/explore.h"
#include "sim/simulation.h"

namespace {

using namespace std::chrono_literals;
using sim::Machine;
using sim::Schedule;
using sim::StrategyName;
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

/* Three wait for the same thing and are told one by one, in an order of free choice. */
void tellOneByOne(Machine &machine, const sim::Plan &) {
  host::Mutex mutex;
  host::Condition told;
  int due = 0;
  for (const char *name : {"ann", "bob", "cid"}) {
    machine.spawn(name, [&] {
      std::unique_lock lock(mutex);
      while (due == 0) told.wait(lock, {"a word", false});
      --due;
    });
  }
  machine.spawn("teller", [&] {
    for (int i = 0; i < 3; ++i) {
      const std::lock_guard lock(mutex);
      ++due;
      told.notifyOne();
    }
  });
  machine.run();
}

/* Takes another course each time. */
void drift(Machine &machine, const sim::Plan &) {
  static int runs = 0;
  machine.spawn("ann", [] {
    for (int i = 0; i < runs; ++i) point();
  });
  ++runs;
}

void goInCircles(Machine &machine, const sim::Plan &) {
  machine.spawn("ann", [] {
    for (volatile bool forever = true; forever;) {
    }
  });
}

void crash(Machine &machine, const sim::Plan &) {
  machine.spawn("ann", [] { raise(SIGSEGV); });
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
                   {.program = "toys", .watched = "watched.so", .plain = "plain.so"});
  const std::string errors = testing::internal::GetCapturedStderr();
  return {status, testing::internal::GetCapturedStdout() + errors};
}

/* By its seed and strategy, which are all that it depends on, each fails again. */
TEST(Chance, FindsWhatItMustWithinSoManyRuns) {
  const struct {
    const char *options, *message;
  } rows[] = {
      {"--scenario lost-update --strategy random --runs 50", "an update was lost: 1"},
      {"--scenario lost-update --strategy random:3 --runs 200", "an update was lost: 1"},
      {"--scenario lost-update --strategy pct:2 --runs 100", "an update was lost: 1"},
      {"--scenario three --strategy random --runs 200 --length 20",
       "three operations, the last one halfway: 2"},
      {"--scenario three --strategy pct:3 --runs 500 --length 20",
       "three operations, the last one halfway: 2"},
  };
  for (const auto &[options, message] : rows) {
    const Answer found = command(options + std::string(" --shorten-runs 0"));
    EXPECT_EQ(found.status, 1) << options;
    EXPECT_THAT(found.text, HasSubstr(std::string("Found: ") + message));
    EXPECT_THAT(command(found.again()).text, HasSubstr(std::string("Found: ") + message));
  }
}

/* Two fibers without a change of priority follow each other whole. */
TEST(Chance, PrioritiesWithoutAChangePreemptNobody) {
  const Answer found = command("--scenario lost-update --strategy pct:1 --runs 200");
  EXPECT_EQ(found.status, 0);
  EXPECT_THAT(found.text, testing::AllOf(HasSubstr("200 runs of 1 scenarios"),
                                         HasSubstr("about 2 different ones")));
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

TEST(Exhaustive, FindsAFaultAtItsBoundAndNotBelow) {
  EXPECT_EQ(command("--scenario lost-update --strategy exhaustive:0").status, 0);
  const Answer found = command("--scenario lost-update --strategy exhaustive:1 --shorten-runs 0");
  EXPECT_THAT(found.text, HasSubstr("Found: an update was lost: 1"));
  EXPECT_THAT(found.again(), ContainsRegex("--schedule [0-9]+:[0-9]+$"));
  EXPECT_EQ(command(found.again()).status, 1);
}

/* ---- One case -------------------------------------------------------------------------------- */

TEST(Replay, TakesTheSameCourseFromTheDeviationsAlone) {
  const Toy toy("telling", &tellOneByOne);
  std::set<uint64_t> courses;
  for (uint64_t seed = 1; seed <= 40; ++seed) {
    sim::ScheduleLog log;
    sim::Case played = sim::makeCase(toy, seed, StrategyName::parse("random"), 0);
    const sim::Outcome first = sim::play(played, {}, &log);
    played.schedule = log.schedule();
    EXPECT_EQ(sim::play(played, {}).hash, first.hash) << "seed " << seed;
    courses.insert(first.hash);
  }
  EXPECT_GT(courses.size(), 20u);
}

TEST(Text, ReadsBackWhatItWrites) {
  const std::vector<sim::Operation> operations = {{0, 1, 2, 3, 4, 5}, {255, 254, 16, 0, 0, 1}};
  const std::vector<sim::PlannedFault> faults = {{sim::Call::KARST_FindEntry, 3, 4}};
  const Schedule schedule = {{3, 1}, {4000000000, 70000}};
  EXPECT_EQ(sim::textOf(operations), "000102030405.fffe10000001");
  EXPECT_EQ(sim::textOf(faults), "KARST_FindEntry:3:4");
  EXPECT_EQ(sim::textOf(schedule), "3:1.4000000000:70000");
  EXPECT_EQ(sim::operationsFrom("000102030405.fffe10000001"), operations);
  EXPECT_EQ(sim::faultsFrom("KARST_FindEntry:3:4"), faults);
  EXPECT_EQ(sim::scheduleFrom("3:1.4000000000:70000"), schedule);
  EXPECT_EQ(sim::scheduleFrom(sim::textOf(Schedule{})), Schedule{});
  for (const char *name : {"default", "random", "random:7", "pct:3", "pct:4:1000", "exhaustive:0"})
    EXPECT_EQ(StrategyName::parse(name).toString(), name);
}

/* ---- Failures -------------------------------------------------------------------------------- */

TEST(Failure, IsOfTheSameKindWhateverItsNumbers) {
  const auto kind = [](const char *message) { return sim::Failure{message, ""}.kind(); };
  EXPECT_EQ(kind("block 0x7ff12ab of 12 bytes, node a0-3f"), "block # of # bytes, node #-#");
  EXPECT_EQ(kind("a face at node2"), "a face at node2");
}

TEST(Crew, ReportsWhatNeverEndsAndWhatCrashes) {
  const auto failureOf = [](Toy::Body body, std::chrono::milliseconds patience = 60s) {
    const Toy toy("toy", body);
    sim::Crew crew(1, patience);
    const auto failure = crew.alone([&] { sim::play(sim::makeCase(toy, 1, {}, 0), {}); });
    return failure ? failure->message : "none";
  };
  EXPECT_THAT(failureOf(&goInCircles, 200ms), HasSubstr("no step within 0 seconds"));
  EXPECT_THAT(failureOf(&crash), ContainsRegex("Segmentation fault|SEGV"));
  EXPECT_THAT(failureOf([](Machine &, const sim::Plan &) { throw std::runtime_error("no"); }),
              "exception: no");
}

/* The least that fails are three operations, no fault and one preemption. On the way there many plans
 * with two fail, in another way. */
TEST(Command, FindsShortensAndRepeats) {
  const std::string least =
      "--scenario three --seed [0-9]+ --operations 000000010000.000000010000.000000010000 "
      "--schedule [0-9]+:[0-9]+$";
  std::string options;
  for (const std::string strategy : {"random", "pct:2"}) {
    const Answer found =
        command("--scenario three --runs 500 --length 20 --shorten-runs 3000 --seed 3 --strategy " +
                strategy);
    EXPECT_EQ(found.status, 1);
    EXPECT_THAT(found.text,
                testing::AllOf(HasSubstr("Found: three operations, the last one halfway: "),
                               HasSubstr("phase 0   somebody         something\n"),
                               ContainsRegex("worker +zel_GetTimerCycles"),
                               HasSubstr("* operation: something\n")));
    options = found.again();
    EXPECT_THAT(options, ContainsRegex(least));
    EXPECT_EQ(command(options).status, 1) << options;
  }
  const std::string file = testing::TempDir() + "cases.txt";
  std::ofstream(file) << "# passes\n--scenario points --seed 1 --schedule -\n";
  EXPECT_EQ(command("--regressions " + file).status, 0);
  std::ofstream(file, std::ios::app) << "# fails\n" << options << "\n";
  const Answer regressed = command("--regressions " + file);
  EXPECT_EQ(regressed.status, 1);
  EXPECT_THAT(regressed.text, HasSubstr("2 cases, 1 failed"));
  EXPECT_THAT(command(options + " --faults zel_HeapCreate:1:1").text,
              HasSubstr("zel_HeapCreate fails at its use 1, 1 times"));
}

TEST(Command, SaysWhatItDid) {
  EXPECT_EQ(command("--scenario points --check-determinism 50").status, 0);
  const Answer drifting = command("--scenario drift --check-determinism 50 --jobs 1");
  EXPECT_EQ(drifting.status, 1);
  EXPECT_THAT(drifting.text, HasSubstr("two runs of one seed differ: 1 steps and 2, "));
  EXPECT_THAT(drifting.text, HasSubstr("--scenario drift --seed 1 --strategy random --runs 1"));
  EXPECT_THAT(command("--scenario points --schedule 0:2").text, HasSubstr("passes: "));
  for (const std::string schedule : {"x", "1", "1:2:3", "1:x", "1:2."})
    EXPECT_EQ(command("--scenario points --schedule " + schedule).status, 2) << schedule;
  for (const std::string strategy : {"walk", "random:0", "pct:0", "random:2:3", "pct:3:", "pct:-1"})
    EXPECT_EQ(command("--scenario points --runs 1 --strategy " + strategy).status, 2) << strategy;
  for (const char *wrong :
       {"--scenario nothing", "--schedule 0:1", "--runs x", "--scenario points --operations 0001",
        "--scenario points --faults nothing:1:1",
        "--scenario points --operations - --strategy pct:3", "--watched --plain",
        "--regressions /no"})
    EXPECT_EQ(command(wrong).status, 2) << wrong;
}

}  // namespace
