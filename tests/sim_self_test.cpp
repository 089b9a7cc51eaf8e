/* The simulator's own promises that no search would miss: what must not happen is reported with
 * names; time, held fibers, worlds and failures do what was asked. The machine is driven directly,
 * without a module.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "host/kernel/heap.h"
#include "host/kernel/text.h"
#include "host/threads/sync.h"
#include "host/threads/worlds.h"
#include "platform/tolm.h"
#include "sim/machine.h"
#include "tests/sim_heap.h"

namespace {

using namespace std::chrono_literals;
using sim::Machine;
using sim::Switching;
using testing::ElementsAre;

/* A world that does `work` whenever it is woken, as a module's world would. */
struct Worker {
  std::function<void()> work;
  zel_WorldID id = ZEL_NO_WORLD;
  bool ended = false;

  static uint32_t body(void *data) {
    auto *self = static_cast<Worker *>(data);
    while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "work") == ZEL_OK) self->work();
    self->ended = true;
    return 0;
  }
  zel_Status start(zel_HeapID heap) {
    return TOLM_WorldCreate(&id, "worker", 0, body, this, 1, heap);
  }
  void stop() { TOLM_WorldDestroy(&id); }
};

/* ---- What must not happen -------------------------------------------------------------------- */

/* Where mistakes are made: on a fiber "culprit", with lock a of rank 1 and b of rank 2. */
struct Scene {
  Machine machine{{.stepLimit = 200}};
  SimHeap heap;
  zel_SpinlockHandle a = heap.lock("lock a", 1);
  zel_SpinlockHandle b = heap.lock("lock b", 2);
  host::Mutex mutex;

  void commit(void (*mistake)(Scene &)) {
    machine.call("culprit", [&] { mistake(*this); });
    machine.run();
  }
};

/* Ann has the mutex and wants the spinlock, Bob the other way round. */
void embrace(Scene &scene) {
  scene.machine.spawn("ann", [&] {
    const std::lock_guard guard(scene.mutex);
    zel_WorldSleep(1);
    zel_SpinlockLock(scene.a);
  });
  scene.machine.spawn("bob", [&] {
    zel_SpinlockLock(scene.a);
    const std::lock_guard guard(scene.mutex);
  });
}

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
      {[](Scene &) { (new SimHeap)->lock("forgotten", 1); },
       "left behind at the end of the simulation:\n  lock domain test\n"
       "  lock forgotten in domain test\n  heap test: 2 blocks"},
      {embrace,
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

/* ---- Fibers, time ----------------------------------------------------------------------------- */

TEST(Fiber, HandlesItsOwnExceptionsAndLetsOthersOut) {
  Machine machine({.seed = 3, .switching = Switching::Random});
  for (int fiber = 0; fiber < 3; ++fiber) {
    machine.spawn("catcher", [fiber] {
      for (int i = 0; i < 20; ++i) {
        try {
          throw fiber * 100 + i;
        } catch (int) {
          zel_GetTimerCycles(); /* others throw and catch meanwhile */
          try {
            std::rethrow_exception(std::current_exception());
          } catch (int mine) {
            EXPECT_EQ(mine, fiber * 100 + i);
          }
        }
      }
    });
  }
  machine.run();
  EXPECT_THROW(machine.call("thrower", [] { throw std::runtime_error("no"); }), std::runtime_error);
}

TEST(Time, PassesOnlyWhenNobodyCanRunAndExactlyAsFarAsAsked) {
  Machine machine({.seed = 5, .switching = Switching::Random});
  std::vector<std::pair<uint32_t, uint64_t>> woken;
  for (const uint32_t microseconds : {300u, 100u, 200u}) {
    machine.spawn("sleeper", [&, microseconds] {
      zel_WorldSleep(microseconds);
      woken.emplace_back(microseconds, zel_TimerTCToNS(zel_GetTimerCycles()));
    });
  }
  machine.spawn("runner", [&] {
    for (int i = 0; i < 100; ++i) EXPECT_EQ(zel_GetTimerCycles(), 0u);
  });
  machine.advance(250us);
  EXPECT_THAT(woken, ElementsAre(std::pair(100u, 100'000u), std::pair(200u, 200'000u)));
  EXPECT_EQ(machine.now(), 250us);
  machine.run();
  EXPECT_EQ(woken.back(), std::pair(300u, uint64_t{300'000}));
  EXPECT_EQ(machine.now(), 300us);
}

TEST(Holding, KeepsFibersBackAndIsNoDeadlock) {
  Machine machine;
  host::Mutex mutex;
  std::string order;
  machine.hold("late");
  machine.spawn("latecomer", [&] { order += 'l'; });
  machine.spawn("holder", [&] {
    const std::lock_guard lock(mutex);
    machine.hold("holder");
    zel_GetTimerCycles();
    order += 'h';
  });
  machine.spawn("waiter", [&] {
    const std::lock_guard lock(mutex);
    order += 'w';
  });
  machine.run();
  EXPECT_THAT(machine.alive(), ElementsAre("fiber latecomer: can run (held back)",
                                           "fiber holder: can run (held back)",
                                           "fiber waiter: waits for a mutex, held by holder"));
  machine.release("holder");
  machine.run();
  EXPECT_EQ(order, "hw");
  machine.releaseAll();
  machine.run();
  EXPECT_EQ(order, "hwl");
}

/* ---- Worlds ---------------------------------------------------------------------------------- */

/* The stop meets a world that has not begun, is about to wait, or waits; with wake-ups or without.
 */
TEST(World, KeepsAWakeUpOnceAndStopsInEveryState) {
  for (const uint64_t steps : {0u, 1u, 2u}) {
    for (const bool stop : {false, true}) {
      Machine machine;
      SimHeap heap;
      int wakeUps = 0;
      Worker worker{[&] { ++wakeUps; }};
      EXPECT_EQ(worker.start(heap.id), ZEL_OK);
      machine.step(steps);
      machine.hold("worker");
      zel_WorldForceWakeup(worker.id);
      zel_WorldForceWakeup(worker.id);
      if (stop) machine.spawn("stopper", [&] { worker.stop(); });
      machine.run();
      EXPECT_NE(worker.id, ZEL_NO_WORLD) << "a stop returns only when the world has ended";
      machine.releaseAll();
      machine.run();
      EXPECT_EQ(wakeUps, stop ? 0 : 1) << "a stop comes before a wake-up";
      EXPECT_EQ(worker.ended, stop) << "after " << steps << " steps";
      if (!stop) machine.call("stopper", [&] { worker.stop(); });
    }
  }
}

TEST(World, WaitsNoLongerThanItsTimeOutAndNeverGivesWayTwiceRunning) {
  Machine machine;
  SimHeap heap;
  Worker worker;
  std::string answers;
  worker.work = [&] {
    const uint64_t start = zel_GetTimerCycles();
    EXPECT_EQ(zel_WorldWait(0, ZEL_NO_SPINLOCK, 20, "time"), ZEL_OK);
    EXPECT_EQ(zel_GetTimerCycles() - start, 20'000'000u);
    for (int i = 0; i < 8; ++i) answers += tolmapi_PreemptionIsPending() ? 'y' : 'n';
  };
  worker.start(heap.id);
  machine.forcePreemption(3);
  zel_WorldForceWakeup(worker.id);
  machine.run();
  EXPECT_EQ(answers, "ynynynnn");
  machine.call("stopper", [&] { worker.stop(); });
}

/* ---- Failures on demand ---------------------------------------------------------------------- */

TEST(Faults, ComeAtExactlyTheUsesAsked) {
  Machine machine;
  SimHeap heap;
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
