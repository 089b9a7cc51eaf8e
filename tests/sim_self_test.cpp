/* The simulator's own promises that no search would miss: what must not happen is reported with
 * names; time, held fibers and failures do what was asked. The machine is driven directly, without a
 * module.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "host/threads/sync.h"
#include "platform/tolm.h"
#include "sim/machine.h"
#include "tests/test_heap.h"

namespace {

using namespace std::chrono_literals;
using sim::Machine;
using sim::Switching;
using testing::ElementsAre;

/* ---- What must not happen -------------------------------------------------------------------- */

/* Where mistakes are made: on a fiber "culprit", with lock a of rank 1 and b of rank 2. */
struct Scene {
  Machine machine{{.stepLimit = 200}};
  TestLocks heap;
  zel_SpinlockHandle a = heap.keep("lock a", 1);
  zel_SpinlockHandle b = heap.keep("lock b", 2);
  host::Mutex mutex;

  void commit(void (*mistake)(Scene &)) {
    machine.call("culprit", [&] { mistake(*this); });
    machine.run();
  }
};

TEST(FatalDeathTest, SaysWhoDidWhat) {
  struct Mistake {
    void (*commit)(Scene &);
    const char *message;
  };
  const Mistake mistakes[] = {
      {[](Scene &s) { zel_SpinlockLock(s.b), zel_SpinlockLock(s.a); },
       "\"lock a\" \\(rank 1\\) is taken while \"lock b\" \\(rank 2\\) is held"},
      {[](Scene &s) { zel_SpinlockLock(s.a), zel_SpinlockLock(s.a); },
       "\"lock a\" \\(rank 1\\) is taken again by culprit"},
      {[](Scene &s) { zel_SpinlockUnlock(s.a); },
       "\"lock a\" is unlocked by culprit while nobody holds it"},
      {[](Scene &s) { zel_SpinlockLock(s.a), zel_SpinlockDestroy(s.a); },
       "\"lock a\" is destroyed while culprit holds it"},
      {[](Scene &s) { zel_SpinlockLock(s.a), zel_WorldSleep(1); },
       "culprit calls zel_WorldSleep while it holds spinlock \"lock a\""},
      {[](Scene &s) { zel_SpinlockLock(s.a); }, "culprit ends while it holds spinlock \"lock a\""},
      {[](Scene &) { (new TestLocks)->keep("forgotten", 1); },
       "left behind at the end of the simulation:\n  lock domain test\n"
       "  lock forgotten in domain test\n  heap test: 2 blocks"},
      /* Ann has the mutex and wants the spinlock, Bob the other way round. */
      {[](Scene &s) {
         s.machine.spawn("ann", [&] {
           const std::lock_guard guard(s.mutex);
           zel_WorldSleep(1);
           zel_SpinlockLock(s.a);
         });
         s.machine.spawn("bob", [&] {
           zel_SpinlockLock(s.a);
           const std::lock_guard guard(s.mutex);
         });
       },
       "deadlock: nobody can run\n  ann: waits for spinlock lock a, held by bob\n"
       "  bob: waits for a mutex, held by ann\n"
       "(.*\n)*seed 1, step [0-9]+; the last calls:\n.*ann .*zel_WorldSleep\\(1\\)"},
      {[](Scene &s) {
         while (s.a != s.b) zel_WorldSleep(1);
       },
       "no quiescence within the step limit\n  culprit: "},
  };
  for (const Mistake &mistake : mistakes)
    EXPECT_DEATH(Scene().commit(mistake.commit), mistake.message);
}

/* ---- What is asked --------------------------------------------------------------------------- */

TEST(Fiber, HandlesItsOwnExceptionAndLetsItOut) {
  Machine machine;
  machine.spawn("thrower", [] {
    try {
      throw 1;
    } catch (int) {
      zel_WorldSleep(1); /* the other one throws and catches meanwhile */
      throw;
    }
  });
  machine.spawn("catcher", [] {
    try {
      throw 2;
    } catch (int) {
      zel_WorldSleep(2);
    }
  });
  EXPECT_THAT([&] { machine.run(); }, testing::Throws<int>(1));
}

TEST(Time, PassesOnlyWhenNobodyCanRunAndExactlyAsFarAsAsked) {
  Machine machine({.seed = 5, .switching = Switching::Random});
  std::vector<uint64_t> woken;
  for (const uint32_t microseconds : {300u, 100u, 200u}) {
    machine.spawn("sleeper", [&, microseconds] {
      zel_WorldSleep(microseconds);
      woken.push_back(zel_TimerTCToNS(zel_GetTimerCycles()));
    });
  }
  machine.spawn("runner", [&] {
    for (int i = 0; i < 100; ++i) EXPECT_EQ(zel_GetTimerCycles(), 0u);
  });
  machine.advance(250us);
  EXPECT_THAT(woken, ElementsAre(100'000, 200'000));
  EXPECT_EQ(machine.now(), 250us);
  machine.run();
  EXPECT_THAT(woken, ElementsAre(100'000, 200'000, 300'000));
  EXPECT_EQ(machine.now(), 300us);
}

TEST(Holding, KeepsBackWhoComesLaterAsWell) {
  Machine machine;
  machine.hold("late");
  const sim::Task latecomer = machine.spawn("latecomer", [] {});
  machine.run();
  EXPECT_FALSE(latecomer.ended());
  machine.release("late");
  machine.run();
  EXPECT_TRUE(latecomer.ended());
}

TEST(Faults, ComeAtExactlyTheUsesAsked) {
  Machine machine;
  TestLocks heap;
  machine.failAt(sim::Call::zel_HeapAllocWithRA, 2, 2);
  std::string got;
  for (int i = 0; i < 5; ++i) {
    uint64_t *block = heap.get(8);
    got += block ? '+' : '-';
    heap.put(block);
  }
  EXPECT_EQ(got, "+--++");
}

}  // namespace
