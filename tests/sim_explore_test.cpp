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
#include "sim/explore/search.h"
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

const Toy lostUpdate("lost-update", &loseUpdate);
const Toy three("three", &needThree);
const Toy points("points", &passPoints);
const Toy telling("telling", &tellOneByOne);

/* ---- Search ---------------------------------------------------------------------------------- */

/* A search of one toy by two children, in plans of twenty operations. */
struct Bench {
  explicit Bench(unsigned jobs = 2) : crew(jobs) {}
  sim::Crew crew;
  sim::Search search{crew, {}, 20, [] {}};

  std::optional<sim::Found> byChance(const Toy &toy, const char *strategy, uint64_t runs) {
    EXPECT_FALSE(search.measure({&toy}));
    return search.byChance(
        {.scenarios = {&toy}, .strategies = {StrategyName::parse(strategy)}, .seed = 1},
        {.runs = runs});
  }
};

TEST(Chance, FindsWhatItMustWithinSoManyRuns) {
  struct Expectation {
    const Toy &toy;
    const char *strategy;
    uint64_t runs;
    const char *message;
  };
  const Expectation expectations[] = {
      {lostUpdate, "random", 50, "an update was lost: 1"},
      {lostUpdate, "random:3", 200, "an update was lost: 1"},
      {lostUpdate, "pct:2", 100, "an update was lost: 1"},
      {three, "random", 200, "three operations, the last one halfway: 2"},
      {three, "pct:3", 500, "three operations, the last one halfway: 2"},
  };
  for (const Expectation &expected : expectations) {
    SCOPED_TRACE(testing::Message() << expected.toy.name() << " " << expected.strategy);
    Bench bench;
    const auto found = bench.byChance(expected.toy, expected.strategy, expected.runs);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->failure.message, expected.message);
    const auto again = bench.crew.alone([&] { sim::play(found->failing, {}); });
    ASSERT_TRUE(again) << "its seed and strategy are all that it depends on";
    EXPECT_EQ(again->message, expected.message);
  }
}

/* Two fibers without a change of priority follow each other whole. */
TEST(Chance, PrioritiesWithoutAChangePreemptNobody) {
  Bench bench;
  EXPECT_FALSE(bench.byChance(lostUpdate, "pct:1", 200));
  EXPECT_EQ(bench.search.figures().runs, 200u);
  EXPECT_NEAR(bench.search.figures().courses, 2, 0.1);
}

/* ---- All schedules --------------------------------------------------------------------------- */

/* Ann's three stretches and Bob's two: of the ten orders, 2 need no preemption, 3 one, 4 two, 1
 * three. */
TEST(Exhaustive, PlaysEveryScheduleOnceWhoeverSharesTheWorkAndSaysWhatItHadNoBudgetFor) {
  using Bounds = std::vector<std::pair<uint64_t, bool>>; /* schedules of each, and whether all */
  const auto search = [](unsigned jobs, uint64_t runs) {
    Bench bench(jobs);
    EXPECT_FALSE(bench.search.exhaust(points, 1, 3, {.runs = runs}));
    Bounds bounds;
    for (const sim::Exhausted &one : bench.search.exhausted())
      bounds.emplace_back(one.schedules, one.complete);
    return bounds;
  };
  const Bounds all = {{2, true}, {5, true}, {9, true}, {10, true}};
  for (const unsigned jobs : {1u, 2u, 3u}) EXPECT_EQ(search(jobs, UINT64_MAX), all) << jobs;
  EXPECT_EQ(search(1, 10), (Bounds{{2, true}, {5, true}, {3, false}}));
}

TEST(Exhaustive, FindsAFaultAtItsBoundAndNotBelow) {
  Bench bench;
  EXPECT_FALSE(bench.search.exhaust(lostUpdate, 1, 0, {}));
  const auto found = bench.search.exhaust(lostUpdate, 1, 1, {});
  ASSERT_TRUE(found);
  EXPECT_EQ(found->failure.message, "an update was lost: 1");
  EXPECT_EQ(found->failing.schedule->size(), 1u);
  EXPECT_TRUE(bench.crew.alone([&] { sim::play(found->failing, {}); }));
}

/* ---- One case -------------------------------------------------------------------------------- */

TEST(Replay, TakesTheSameCourseFromTheDeviationsAlone) {
  std::set<uint64_t> courses;
  for (uint64_t seed = 1; seed <= 40; ++seed) {
    sim::ScheduleLog log;
    sim::Case played = sim::makeCase(telling, seed, StrategyName::parse("random"), 0);
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

/* ---- The command ----------------------------------------------------------------------------- */

struct Answer {
  int status;
  std::string text;
};

Answer command(const std::string &options) {
  std::vector<std::unique_ptr<sim::Scenario>> scenarios;
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

/* The least that fails are three operations, no fault and one preemption. On the way there many plans
 * with two fail, in another way. */
TEST(Command, FindsShortensAndRepeats) {
  const std::string mark = "Again:   toys ";
  const std::string least = mark +
                            "--scenario three --seed [0-9]+ --operations "
                            "000000010000.000000010000.000000010000 --schedule [0-9]+:[0-9]+\n";
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
                               HasSubstr("* operation: something\n"), ContainsRegex(least)));
    const size_t begin = found.text.find(mark) + mark.size();
    options = found.text.substr(begin, found.text.find('\n', begin) - begin);
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
  EXPECT_EQ(command("--scenario points --runs 100").status, 0);
  EXPECT_EQ(command("--scenario points --check-determinism 50").status, 0);
  const Answer drifting = command("--scenario drift --check-determinism 50 --jobs 1");
  EXPECT_EQ(drifting.status, 1);
  EXPECT_THAT(drifting.text, HasSubstr("two runs of one seed differ: 1 steps and 2, "));
  EXPECT_THAT(drifting.text, HasSubstr("--scenario drift --seed 1 --strategy random --runs 1"));
  EXPECT_THAT(command("--scenario points --strategy exhaustive:1 --runs 9 --jobs 1").text,
              HasSubstr("points, seed 1, at most 1 preemptions: 5 schedules, which are all"));
  EXPECT_THAT(command("--scenario points --schedule 0:2").text, HasSubstr("passes: "));
  for (const std::string schedule : {"x", "1", "1:2:3", "1:x", "1:2."})
    EXPECT_EQ(command("--scenario points --schedule " + schedule).status, 2) << schedule;
  for (const std::string strategy : {"walk", "random:0", "pct:0", "random:2:3", "pct:3:", "pct:-1"})
    EXPECT_EQ(command("--scenario points --strategy " + strategy).status, 2) << strategy;
  for (const char *wrong :
       {"--scenario nothing", "--schedule 0:1", "--runs x", "--scenario points --operations 0001",
        "--scenario points --faults nothing:1:1",
        "--scenario points --operations - --strategy pct:3", "--watched --plain",
        "--regressions /no"})
    EXPECT_EQ(command(wrong).status, 2) << wrong;
}

}  // namespace
