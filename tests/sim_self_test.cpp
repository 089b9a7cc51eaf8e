/* The simulator's own promises: the same seed takes the same course, nothing that can happen is
 * lost, what must not happen is reported with names. The machine is driven directly, without a
 * module.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "host/directory/records.h"
#include "host/kernel/heap.h"
#include "host/kernel/text.h"
#include "host/threads/sync.h"
#include "host/threads/worlds.h"
#include "platform/tolm.h"
#include "sim/simulation.h"

namespace {

using namespace std::chrono_literals;
using sim::Call;
using sim::Machine;
using sim::Switching;
using testing::ElementsAre;
using testing::HasSubstr;

/* A heap, a lock domain and locks, as a module has them. */
class Locks {
 public:
  Locks() {
    zel_HeapProps props{};
    host::fillName(&props.name, "test");
    props.initialSize = 4096;
    props.maximumSize = 1 << 20;
    EXPECT_EQ(zel_HeapCreate(&props, &heap_), ZEL_OK);
    EXPECT_EQ(zel_LockDomainCreate(0, heap_, &props.name, &domain_), ZEL_OK);
  }
  ~Locks() {
    for (const zel_SpinlockHandle lock : locks_) zel_SpinlockDestroy(lock);
    zel_LockDomainDestroy(domain_);
    zel_HeapDestroy(heap_);
  }
  zel_SpinlockProps props(const char *name, uint16_t rank) const {
    zel_SpinlockProps props{};
    host::fillName(&props.name, name);
    props.heap = heap_;
    props.type = ZEL_SPINLOCK_RANKED;
    props.domain = domain_;
    props.rank = rank;
    return props;
  }
  zel_SpinlockHandle make(const char *name, uint16_t rank) {
    const zel_SpinlockProps wanted = props(name, rank);
    zel_SpinlockHandle lock = ZEL_NO_SPINLOCK;
    EXPECT_EQ(zel_SpinlockCreate(&wanted, &lock), ZEL_OK);
    locks_.push_back(lock);
    return lock;
  }
  zel_HeapID heap() const { return heap_; }

 private:
  zel_HeapID heap_ = ZEL_NO_HEAP;
  zel_LockDomainID domain_ = ZEL_NO_LOCK_DOMAIN;
  std::vector<zel_SpinlockHandle> locks_;
};

/* A world that counts its wake-ups, as a module's world would. */
struct CountingWorld {
  int wakeUps = 0;
  bool ended = false;
  zel_WorldID id = ZEL_NO_WORLD;

  static uint32_t body(void *data) {
    auto *self = static_cast<CountingWorld *>(data);
    while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "work") != ZEL_WORLD_STOPPING)
      ++self->wakeUps;
    self->ended = true;
    return 0;
  }
  zel_Status start(zel_HeapID heap) {
    return TOLM_WorldCreate(&id, "counter", 0, body, this, 1, heap);
  }
  void stop() { TOLM_WorldDestroy(&id); }
};

/* ---- One seed, one course -------------------------------------------------------------------- */

struct Course {
  uint64_t hash;
  std::vector<sim::HistoryEntry> history;
  std::string order;
};

/* Three fibers that meet at a lock, a world that they wake, a sleeper. */
Course playThrough(uint64_t seed) {
  Machine machine({.seed = seed, .switching = Switching::Random});
  machine.setPreemption(sim::Preemption::Random);
  Course course{};
  {
    Locks locks;
    const zel_SpinlockHandle lock = locks.make("shared", 1);
    CountingWorld world;
    world.start(locks.heap());
    for (const char name : {'a', 'b', 'c'}) {
      machine.spawn(std::string(1, name), [&, name] {
        for (int i = 0; i < 5; ++i) {
          zel_SpinlockLock(lock);
          course.order += name;
          zel_WorldForceWakeup(world.id);
          zel_SpinlockUnlock(lock);
          if (i == 2) zel_WorldSleep(10);
        }
      });
    }
    machine.run();
    machine.call("end", [&] { world.stop(); });
  }
  course.hash = machine.traceHash();
  course.history = machine.history();
  return course;
}

TEST(Seed, TheSameTakesTheSameCourse) {
  for (uint64_t seed = 1; seed <= 50; ++seed) {
    const Course once = playThrough(seed);
    const Course again = playThrough(seed);
    EXPECT_EQ(once.hash, again.hash) << "seed " << seed;
    EXPECT_EQ(once.order, again.order) << "seed " << seed;
    EXPECT_TRUE(once.history == again.history) << "seed " << seed;
  }
}

TEST(Seed, DifferentOnesTakeDifferentCourses) {
  std::set<uint64_t> hashes;
  std::set<std::string> orders;
  for (uint64_t seed = 1; seed <= 100; ++seed) {
    const Course course = playThrough(seed);
    hashes.insert(course.hash);
    orders.insert(course.order);
  }
  EXPECT_EQ(hashes.size(), 100u);
  EXPECT_GT(orders.size(), 90u);
}

TEST(Seed, ReachesEveryOrderOfTwoFibers) {
  std::set<std::string> orders;
  for (uint64_t seed = 1; seed <= 200; ++seed) {
    Machine machine({.seed = seed, .switching = Switching::Random});
    std::string order;
    for (const char name : {'a', 'b'}) {
      machine.spawn(std::string(1, name), [&, name] {
        for (int i = 0; i < 3; ++i) {
          zel_GetTimerCycles();
          order += name;
        }
      });
    }
    machine.run();
    orders.insert(order);
  }
  EXPECT_EQ(orders.size(), 20u) << "6 over 3 ways to merge two runs of three";
}

TEST(Switching, WhenBlockedRunsEachFiberAsFarAsItCan) {
  Machine machine;
  std::string order;
  for (const char name : {'a', 'b', 'c'}) {
    machine.spawn(std::string(1, name), [&, name] {
      order += name;
      zel_GetTimerCycles();
      order += name;
      zel_WorldSleep(1);
      order += name;
    });
  }
  machine.run();
  EXPECT_EQ(order, "aabbccabc");
}

/* ---- Locks ----------------------------------------------------------------------------------- */

TEST(Spinlock, LetsOneFiberInAtATime) {
  for (uint64_t seed = 1; seed <= 100; ++seed) {
    Machine machine({.seed = seed, .switching = Switching::Random});
    Locks locks;
    const zel_SpinlockHandle lock = locks.make("shared", 1);
    int inside = 0;
    int entries = 0;
    for (int fiber = 0; fiber < 4; ++fiber) {
      machine.spawn("fiber", [&] {
        for (int i = 0; i < 10; ++i) {
          zel_SpinlockLock(lock);
          EXPECT_EQ(++inside, 1);
          zel_GetTimerCycles(); /* others get their chance */
          --inside;
          ++entries;
          zel_SpinlockUnlock(lock);
        }
      });
    }
    machine.run();
    EXPECT_EQ(entries, 40);
  }
}

TEST(Spinlock, AnyWaiterMayBeNext) {
  std::set<std::string> orders;
  for (uint64_t seed = 1; seed <= 200; ++seed) {
    Machine machine;
    Locks locks;
    const zel_SpinlockHandle lock = locks.make("shared", 1);
    std::string order;
    zel_SpinlockLock(lock);
    for (const char name : {'a', 'b', 'c'}) {
      machine.spawn(std::string(1, name), [&, name] {
        zel_SpinlockLock(lock);
        order += name;
        zel_SpinlockUnlock(lock);
      });
    }
    machine.step(6); /* all three wait */
    EXPECT_EQ(order, "");
    machine.setStrategy(std::make_unique<sim::RandomWalk>(seed));
    zel_SpinlockUnlock(lock);
    machine.run();
    orders.insert(order);
  }
  EXPECT_EQ(orders.size(), 6u);
}

TEST(Spinlock, RefusesWhatTheHeapOrTheCallerCannotGive) {
  Machine machine;
  Locks locks;
  zel_SpinlockHandle lock = ZEL_NO_SPINLOCK;
  zel_SpinlockProps props = locks.props("lock", 1);
  props.type = 7;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_BAD_PARAM);
  props = locks.props("lock", 1);
  props.domain = ZEL_NO_LOCK_DOMAIN;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_BAD_PARAM);
  props = locks.props("lock", 1);
  props.heap = ZEL_NO_HEAP;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_BAD_PARAM);
  EXPECT_EQ(lock, ZEL_NO_SPINLOCK);
}

TEST(Spinlock, TakesFromItsHeapWhatItSays) {
  Machine machine;
  Locks locks;
  const uint32_t before = host::heapState(locks.heap()).used;
  locks.make("lock", 1);
  EXPECT_EQ(host::heapState(locks.heap()).used - before,
            zel_SpinlockAllocSize(ZEL_SPINLOCK_RANKED));
}

using SpinlockDeath = testing::Test;

/* Runs a mistake on a fiber named "culprit", with lock a of rank 1 and b of rank 2. */
template <typename Mistake>
void commit(Mistake mistake) {
  Machine machine;
  Locks locks;
  const zel_SpinlockHandle a = locks.make("lock a", 1);
  const zel_SpinlockHandle b = locks.make("lock b", 2);
  machine.call("culprit", [&] { mistake(locks, a, b); });
}

TEST(SpinlockDeath, NamesBothLocksOfAWrongOrder) {
  EXPECT_DEATH(commit([](Locks &, auto a, auto b) {
                 zel_SpinlockLock(b);
                 zel_SpinlockLock(a);
               }),
               "\"lock a\" \\(rank 1\\) is taken while \"lock b\" \\(rank 2\\) is held");
}

TEST(SpinlockDeath, NamesTheLockTakenTwice) {
  EXPECT_DEATH(commit([](Locks &, auto a, auto) {
                 zel_SpinlockLock(a);
                 zel_SpinlockLock(a);
               }),
               "\"lock a\" \\(rank 1\\) is taken again by culprit");
}

TEST(SpinlockDeath, NamesWhoUnlocksWhatAnotherHolds) {
  EXPECT_DEATH(commit([](Locks &, auto a, auto) {
                 Machine::current().spawn("other", [a] { zel_SpinlockUnlock(a); });
                 zel_SpinlockLock(a);
                 zel_WorldForceWakeup(1);
                 Machine::current().setSwitching(Switching::Random);
                 for (int i = 0; i < 100; ++i) zel_GetTimerCycles();
               }),
               "\"lock a\" is unlocked by other but held by culprit");
  EXPECT_DEATH(commit([](Locks &, auto a, auto) { zel_SpinlockUnlock(a); }),
               "\"lock a\" is unlocked by culprit while nobody holds it");
}

TEST(SpinlockDeath, SaysWhoSleepsWithALockHeld) {
  EXPECT_DEATH(commit([](Locks &, auto a, auto) {
                 zel_SpinlockLock(a);
                 zel_WorldSleep(1);
               }),
               "culprit calls zel_WorldSleep while it holds spinlock \"lock a\"");
  EXPECT_DEATH(commit([](Locks &locks, auto a, auto) {
                 CountingWorld world;
                 zel_SpinlockLock(a);
                 world.start(locks.heap());
               }),
               "culprit calls TOLM_WorldCreate while it holds spinlock \"lock a\"");
  EXPECT_DEATH(commit([](Locks &, auto a, auto) { zel_SpinlockLock(a); }),
               "culprit ends while it holds spinlock \"lock a\"");
}

TEST(SpinlockDeath, SaysWhoHoldsADestroyedLock) {
  EXPECT_DEATH(commit([](Locks &, auto a, auto) {
                 zel_SpinlockLock(a);
                 zel_SpinlockDestroy(a);
               }),
               "\"lock a\" is destroyed while culprit holds it");
}

/* ---- Deadlocks ------------------------------------------------------------------------------- */

/* Two mutexes, two fibers, each holds one and wants the other. */
void embrace() {
  Machine machine;
  host::Mutex first;
  host::Mutex second;
  machine.spawn("ann", [&] {
    const std::lock_guard holdsFirst(first);
    zel_WorldSleep(1);
    const std::lock_guard holdsSecond(second);
  });
  machine.spawn("bob", [&] {
    const std::lock_guard holdsSecond(second);
    zel_WorldSleep(1);
    const std::lock_guard holdsFirst(first);
  });
  machine.run();
}

TEST(DeadlockDeath, SaysWhoWaitsForWhatHeldByWhom) {
  EXPECT_DEATH(embrace(),
               "deadlock: nobody can run\n  ann: waits for a mutex, held by bob\n  bob: waits for "
               "a mutex, held by ann");
}

TEST(DeadlockDeath, ShowsTheSeedAndTheLastCalls) {
  EXPECT_DEATH(embrace(), "seed 1, step [0-9]+; the last calls:\n.*ann .*zel_WorldSleep\\(1\\)");
}

void waitForALockThatNobodyGivesBack() {
  Machine machine;
  Locks locks;
  const zel_SpinlockHandle lock = locks.make("kept", 1);
  zel_SpinlockLock(lock);
  machine.call("waiter", [&] { zel_SpinlockLock(lock); });
}

TEST(DeadlockDeath, NamesTheSpinlock) {
  EXPECT_DEATH(waitForALockThatNobodyGivesBack(),
               "waiter: waits for spinlock kept, held by driver");
}

TEST(DeadlockDeath, FindsARunThatGoesInCircles) {
  EXPECT_DEATH(
      {
        Machine machine({.stepLimit = 1000});
        machine.call("circler", [] {
          for (;;) zel_WorldSleep(1);
        });
      },
      "no quiescence within the step limit\n  circler: ");
}

TEST(DeadlockDeath, SaysWhatIsLeftBehind) {
  EXPECT_DEATH(
      {
        Machine machine;
        auto *locks = new Locks;
        locks->make("forgotten", 1);
      },
      "left behind at the end of the simulation:\n  lock domain test\n  lock forgotten in domain "
      "test\n  heap test: 2 blocks");
}

/* ---- Quiescence ------------------------------------------------------------------------------ */

TEST(Quiescence, IsReachedWithIdleWaiters) {
  Machine machine;
  host::Mutex mutex;
  host::Condition work;
  bool due = false;
  bool done = false;
  machine.spawn("worker", [&] {
    std::unique_lock lock(mutex);
    while (!due) work.wait(lock, {"work", true});
    done = true;
  });
  machine.run();
  EXPECT_FALSE(done);
  EXPECT_THAT(machine.alive(), ElementsAre("fiber worker: waits for work (idle)"));
  {
    const std::lock_guard lock(mutex);
    due = true;
    work.notifyOne();
  }
  EXPECT_FALSE(done) << "the driver's notification makes nobody run by itself";
  machine.run();
  EXPECT_TRUE(done);
}

TEST(Quiescence, NoNotificationIsLostInAnyOrder) {
  for (uint64_t seed = 1; seed <= 300; ++seed) {
    Machine machine({.seed = seed, .switching = Switching::Random});
    host::Mutex mutex;
    host::Condition changed;
    int due = 0;
    int taken = 0;
    for (int fiber = 0; fiber < 2; ++fiber) {
      machine.spawn("taker", [&] {
        for (int i = 0; i < 3; ++i) {
          std::unique_lock lock(mutex);
          while (due == 0) changed.wait(lock, {"something due", false});
          --due;
          ++taken;
        }
      });
      machine.spawn("giver", [&] {
        for (int i = 0; i < 3; ++i) {
          const std::lock_guard lock(mutex);
          ++due;
          changed.notifyOne();
        }
      });
    }
    machine.run(); /* a lost one would be a deadlock */
    EXPECT_EQ(taken, 6);
  }
}

TEST(Quiescence, ADriverThatWaitsLetsTheFibersRun) {
  Machine machine;
  host::Mutex mutex;
  host::Condition changed;
  int value = 0;
  machine.spawn("holder", [&] {
    const std::lock_guard lock(mutex);
    zel_WorldSleep(5);
    value = 1;
    changed.notifyAll();
  });
  machine.step(3); /* it has the mutex and sleeps */
  std::unique_lock lock(mutex);
  EXPECT_EQ(value, 1);
  EXPECT_EQ(machine.now(), 5us);
  machine.spawn("setter", [&] {
    const std::lock_guard setterLock(mutex);
    value = 2;
    changed.notifyAll();
  });
  while (value != 2) changed.wait(lock, {"value 2", false});
  EXPECT_EQ(value, 2);
}

TEST(Quiescence, AnExceptionComesOutOfTheCall) {
  Machine machine;
  EXPECT_THROW(machine.call("thrower", [] { throw std::runtime_error("refused"); }),
               std::runtime_error);
  EXPECT_THAT(machine.alive(), ElementsAre());
  EXPECT_EQ(machine.call("next", [] { return 7; }), 7);
}

TEST(Quiescence, EachFiberHandlesItsOwnExceptions) {
  Machine machine({.seed = 3, .switching = Switching::Random});
  int wrong = 0;
  for (int fiber = 0; fiber < 3; ++fiber) {
    machine.spawn("thrower", [&, fiber] {
      for (int i = 0; i < 20; ++i) {
        try {
          zel_GetTimerCycles();
          throw fiber * 100 + i;
        } catch (int value) {
          zel_GetTimerCycles(); /* others throw and catch meanwhile */
          try {
            std::rethrow_exception(std::current_exception());
          } catch (int again) {
            wrong += again != fiber * 100 + i || again != value;
          }
        }
      }
    });
  }
  machine.run();
  EXPECT_EQ(wrong, 0);
}

int fillStack(int depth) {
  volatile char page[4096];
  page[0] = static_cast<char>(depth);
  return depth == 0 ? 0 : fillStack(depth - 1) + page[0];
}

TEST(FiberDeath, AStackThatOverflowsHitsItsGuard) {
  Machine machine;
  EXPECT_EQ(machine.call("shallow", [] { return fillStack(10) != -1; }), true);
  EXPECT_DEATH(machine.call("deep", [] { return fillStack(1000); }), "");
}

TEST(Fiber, FramePointersEndWhereItsStackDoes) {
  Machine machine;
  machine.call("caller", [] {
    EXPECT_NE(tolmapi_GetReturnAddress(0), 0u);
    EXPECT_EQ(tolmapi_GetReturnAddress(1000), 0u);
  });
}

/* ---- Time ------------------------------------------------------------------------------------ */

TEST(Time, SleepersWakeInTheOrderOfTheirTimes) {
  Machine machine;
  std::vector<std::pair<uint32_t, uint64_t>> woken;
  for (const uint32_t microseconds : {100u, 300u, 100u, 200u}) {
    machine.spawn("sleeper", [&, microseconds] {
      zel_WorldSleep(microseconds);
      woken.emplace_back(microseconds, zel_TimerTCToNS(zel_GetTimerCycles()));
    });
  }
  machine.run();
  EXPECT_THAT(woken, ElementsAre(std::pair(100u, 100'000u), std::pair(100u, 100'000u),
                                 std::pair(200u, 200'000u), std::pair(300u, 300'000u)));
}

TEST(Time, StandsStillWhileSomebodyCanRun) {
  Machine machine({.seed = 5, .switching = Switching::Random});
  bool finished = false;
  machine.spawn("sleeper", [&] {
    zel_WorldSleep(1);
    EXPECT_TRUE(finished);
  });
  machine.spawn("runner", [&] {
    for (int i = 0; i < 100; ++i) EXPECT_EQ(zel_GetTimerCycles(), 0u);
    finished = true;
  });
  machine.run();
  EXPECT_EQ(machine.now(), 1us);
}

TEST(Time, AdvanceGoesExactlySoFar) {
  Machine machine;
  int ticks = 0;
  bool stop = false;
  machine.spawn("ticker", [&] {
    while (!stop) {
      zel_WorldSleep(100'000);
      ++ticks;
    }
  });
  machine.advance(250ms);
  EXPECT_EQ(ticks, 2);
  EXPECT_EQ(machine.now(), 250ms);
  stop = true;
  machine.run();
  EXPECT_EQ(ticks, 3);
  EXPECT_EQ(machine.now(), 300ms);
}

/* ---- Holding back ---------------------------------------------------------------------------- */

TEST(Holding, KeepsFibersOfTheNameFromRunning) {
  Machine machine;
  std::string order;
  machine.hold("slow");
  machine.spawn("slow one", [&] { order += 's'; });
  machine.spawn("quick", [&] { order += 'q'; });
  machine.run();
  EXPECT_EQ(order, "q");
  EXPECT_THAT(machine.alive(), ElementsAre("fiber slow one: can run (held back)"));
  machine.release("slow");
  machine.run();
  EXPECT_EQ(order, "qs");
}

TEST(Holding, AFiberCanHoldItselfBackInTheMiddle) {
  Machine machine;
  int passed = 0;
  machine.spawn("careful", [&] {
    passed = 1;
    machine.hold("careful");
    zel_GetTimerCycles();
    passed = 2;
  });
  machine.run();
  EXPECT_EQ(passed, 1);
  machine.releaseAll();
  machine.run();
  EXPECT_EQ(passed, 2);
}

TEST(Holding, WaitingForOneThatIsHeldBackIsNoDeadlock) {
  Machine machine;
  host::Mutex mutex;
  bool got = false;
  machine.spawn("holder", [&] {
    const std::lock_guard lock(mutex);
    machine.hold("holder");
    zel_GetTimerCycles();
  });
  machine.spawn("waiter", [&] {
    const std::lock_guard lock(mutex);
    got = true;
  });
  machine.run();
  EXPECT_FALSE(got);
  machine.releaseAll();
  machine.run();
  EXPECT_TRUE(got);
}

TEST(Holding, StepsLeadFromPointToPoint) {
  Machine machine;
  int passed = 0;
  machine.spawn("walker", [&] {
    for (int i = 0; i < 3; ++i) {
      zel_GetTimerCycles();
      ++passed;
    }
  });
  std::vector<int> seen;
  while (machine.step()) seen.push_back(passed);
  EXPECT_THAT(seen, ElementsAre(0, 1, 2));
  EXPECT_EQ(passed, 3);
}

/* ---- Worlds ---------------------------------------------------------------------------------- */

TEST(World, NoWakeUpIsLostInAnyOrder) {
  for (uint64_t seed = 1; seed <= 300; ++seed) {
    Machine machine({.seed = seed, .switching = Switching::Random});
    Locks locks;
    const zel_SpinlockHandle lock = locks.make("queue", 1);
    struct Queue {
      zel_SpinlockHandle lock;
      int due = 0;
      int served = 0;
    } queue{lock};
    zel_WorldID world = ZEL_NO_WORLD;
    const auto body = [](void *data) -> uint32_t {
      auto *work = static_cast<Queue *>(data);
      do {
        zel_SpinlockLock(work->lock);
        work->served += std::exchange(work->due, 0);
        zel_SpinlockUnlock(work->lock);
      } while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "work") == ZEL_OK);
      return 0;
    };
    EXPECT_EQ(TOLM_WorldCreate(&world, "server", 0, body, &queue, 1, locks.heap()), ZEL_OK);
    for (int fiber = 0; fiber < 2; ++fiber) {
      machine.spawn("giver", [&] {
        for (int i = 0; i < 5; ++i) {
          zel_SpinlockLock(lock);
          ++queue.due;
          zel_WorldForceWakeup(world);
          zel_SpinlockUnlock(lock);
        }
      });
    }
    machine.run();
    EXPECT_EQ(queue.served, 10) << "seed " << seed;
    machine.call("stopper", [&] { TOLM_WorldDestroy(&world); });
    EXPECT_EQ(world, ZEL_NO_WORLD);
  }
}

TEST(World, AWakeUpBeforeTheWaitIsKeptOnce) {
  Machine machine;
  Locks locks;
  CountingWorld world;
  machine.hold("counter");
  EXPECT_EQ(world.start(locks.heap()), ZEL_OK);
  zel_WorldForceWakeup(world.id);
  zel_WorldForceWakeup(world.id);
  machine.run();
  EXPECT_EQ(world.wakeUps, 0);
  machine.releaseAll();
  machine.run();
  EXPECT_EQ(world.wakeUps, 1);
  EXPECT_THAT(host::aliveWorldsAndLocks(),
              ElementsAre("world counter (waits: work)", "lock domain test"));
  machine.call("stopper", [&] { world.stop(); });
  zel_WorldForceWakeup(1); /* a world that has ended */
}

/* The stop meets a world that has not begun, is about to wait, or waits; with a wake-up or without.
 */
TEST(World, StopsInEveryState) {
  const auto stopAfter = [](uint64_t steps, bool wake) {
    Machine machine;
    Locks locks;
    CountingWorld world;
    EXPECT_EQ(world.start(locks.heap()), ZEL_OK);
    machine.step(steps);
    machine.hold("counter");
    if (wake) zel_WorldForceWakeup(world.id);
    machine.spawn("stopper", [&] { world.stop(); });
    machine.run();
    EXPECT_NE(world.id, ZEL_NO_WORLD) << "returns only when the world has ended";
    machine.releaseAll();
    machine.run();
    EXPECT_TRUE(world.ended) << "after " << steps << " steps";
    EXPECT_EQ(world.id, ZEL_NO_WORLD);
    EXPECT_EQ(world.wakeUps, 0) << "a stop comes before a wake-up";
  };
  for (const uint64_t steps : {0u, 1u, 2u}) {
    stopAfter(steps, false);
    stopAfter(steps, true);
  }
}

TEST(World, ATimeOutEndsTheWait) {
  Machine machine;
  Locks locks;
  zel_WorldID world = ZEL_NO_WORLD;
  uint64_t wokenAt = 0;
  const auto body = [](void *data) -> uint32_t {
    EXPECT_EQ(zel_WorldWait(0, ZEL_NO_SPINLOCK, 20, "time"), ZEL_OK);
    *static_cast<uint64_t *>(data) = zel_GetTimerCycles();
    return 0;
  };
  EXPECT_EQ(TOLM_WorldCreate(&world, "timed", 0, body, &wokenAt, 1, locks.heap()), ZEL_OK);
  machine.run();
  EXPECT_EQ(wokenAt, 20'000'000u);
  machine.call("stopper", [&] { TOLM_WorldDestroy(&world); });
}

TEST(World, PreemptionNeverSaysYesTwiceRunning) {
  Machine machine;
  Locks locks;
  std::string answers;
  const auto body = [](void *data) -> uint32_t {
    auto *text = static_cast<std::string *>(data);
    for (int i = 0; i < 8; ++i) *text += tolmapi_PreemptionIsPending() ? 'y' : 'n';
    return 0;
  };
  const auto ask = [&] {
    answers.clear();
    zel_WorldID world = ZEL_NO_WORLD;
    EXPECT_EQ(TOLM_WorldCreate(&world, "asker", 0, body, &answers, 1, locks.heap()), ZEL_OK);
    machine.call("stopper", [&] { TOLM_WorldDestroy(&world); });
    return answers;
  };
  EXPECT_EQ(ask(), "nnnnnnnn");
  machine.forcePreemption(3);
  EXPECT_EQ(ask(), "ynynynnn");
  machine.setPreemption(sim::Preemption::Random);
  std::set<std::string> seen;
  machine.setSwitching(Switching::Random);
  for (int i = 0; i < 50; ++i) seen.insert(ask());
  EXPECT_GT(seen.size(), 5u);
  for (const std::string &answer : seen) EXPECT_THAT(answer, testing::Not(HasSubstr("yy")));
}

/* ---- Failures on demand ---------------------------------------------------------------------- */

TEST(Faults, ComeAtExactlyTheUseAsked) {
  Machine machine;
  Locks locks;
  const auto allocate = [&] {
    void *block = zel_HeapAllocWithRA(locks.heap(), 8, nullptr);
    zel_HeapFree(locks.heap(), block);
    return block ? '+' : '-';
  };
  const auto allocateTimes = [&](int times) {
    std::string got;
    for (int i = 0; i < times; ++i) got += allocate();
    return got;
  };
  allocate();
  machine.failAt(Call::zel_HeapAllocWithRA, 3);
  EXPECT_EQ(allocateTimes(5), "++-++") << "counted from the moment of asking";
  machine.failAt(Call::zel_HeapAllocWithRA, 2, 2);
  EXPECT_EQ(allocateTimes(5), "+--++");
  machine.failAt(Call::zel_HeapAllocWithRA, 2, Machine::everyFurther);
  EXPECT_EQ(allocateTimes(4), "+---");
  machine.clearFaults();
  EXPECT_EQ(allocateTimes(2), "++");
  EXPECT_EQ(machine.faultsInjected(), 6u);
  EXPECT_EQ(machine.uses(Call::zel_HeapAllocWithRA), 17u);
}

TEST(Faults, HaveTheStatusAskedForAndNoEffect) {
  Machine machine;
  Locks locks;
  CountingWorld world;
  machine.failAt(Call::TOLM_WorldCreate, 1);
  machine.failAt(Call::TOLM_WorldCreate, 2, 1, ZEL_FAILURE);
  EXPECT_EQ(world.start(locks.heap()), ZEL_NO_MEMORY);
  EXPECT_EQ(world.start(locks.heap()), ZEL_FAILURE);
  EXPECT_EQ(world.id, ZEL_NO_WORLD);
  EXPECT_THAT(host::aliveWorldsAndLocks(), ElementsAre("lock domain test"));
  const std::vector<sim::HistoryEntry> history = machine.history();
  EXPECT_EQ(history.back().call, Call::TOLM_WorldCreate);
  EXPECT_TRUE(history.back().injected);
  EXPECT_EQ(history.back().result, ZEL_FAILURE);
}

TEST(FaultsDeath, OnlyForCallsThatCanFail) {
  EXPECT_DEATH(
      {
        Machine machine;
        machine.failAt(Call::zel_SpinlockLock, 1);
      },
      "zel_SpinlockLock cannot fail");
}

/* ---- History --------------------------------------------------------------------------------- */

TEST(History, KeepsTheLastCallsAndSaysWhoDidWhat) {
  Machine machine({.historyLength = 4});
  machine.call("first", [] {
    for (uint32_t i = 1; i <= 6; ++i) zel_WorldSleep(i);
  });
  std::vector<std::string> kept;
  for (const sim::HistoryEntry &entry : machine.history())
    kept.push_back(*entry.fiberName + " " + sim::traits(entry.call).name + " " +
                   entry.argument.toString() + " at " + std::to_string(entry.time / 1000));
  EXPECT_THAT(kept, ElementsAre("first zel_WorldSleep 3 at 3", "first zel_WorldSleep 4 at 6",
                                "first zel_WorldSleep 5 at 10", "first zel_WorldSleep 6 at 15"));
  machine.clearHistory();
  EXPECT_TRUE(machine.history().empty());
}

/* ---- The whole ------------------------------------------------------------------------------- */

struct Seen {
  std::vector<zel_Status> statuses;
  static zel_Status callback(void *data, const KarstEntryHeader *, void *, zel_Status status) {
    static_cast<Seen *>(data)->statuses.push_back(status);
    return ZEL_OK;
  }
};

KarstQuery allOfType(uint8_t type) {
  KarstQuery query{};
  query.type = type;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL;
  return query;
}

TEST(Simulation, TheDirectoryDeliversOnFibers) {
  sim::Simulation sim({.deliveryThreads = 1});
  const KarstQuery query = allOfType(3);
  const zel_UUID node{{1}};
  sim.directory().put({.type = 3, .uuid = node, .owner = node, .data = {}});
  Seen seen;
  EXPECT_EQ(KARST_Subscribe(&query, Seen::callback, &seen), ZEL_OK);
  EXPECT_TRUE(seen.statuses.empty());
  sim.run();
  EXPECT_THAT(seen.statuses, ElementsAre(ZEL_OK));
  sim.hold("karst-delivery");
  sim.directory().remove(3, node);
  KARST_Unsubscribe(&query, Seen::callback, &seen);
  sim.run();
  EXPECT_THAT(seen.statuses, ElementsAre(ZEL_OK)) << "held back";
  sim.releaseAll();
  sim.run();
  EXPECT_THAT(seen.statuses, ElementsAre(ZEL_OK, ZEL_SUB_CANCELLED));
}

TEST(Simulation, EveryDirectoryCallCanFail) {
  sim::Simulation sim;
  const KarstQuery query = allOfType(3);
  KarstEntryHeader header{};
  sim.failAt(Call::KARST_Subscribe, 1);
  sim.failAt(Call::KARST_FindEntry, 1);
  EXPECT_EQ(KARST_Subscribe(&query, Seen::callback, nullptr), ZEL_NO_MEMORY);
  EXPECT_EQ(KARST_FindEntry(&query, 0, &header, sizeof header), ZEL_FAILURE);
  EXPECT_EQ(KARST_FindEntry(&query, 0, &header, sizeof header), ZEL_NOT_FOUND);
  EXPECT_EQ(sim.directory().subscriptions(), 0u);

  const std::vector<uint8_t> data = host::encode(KarstNodeEntry{7, 0, 0, 0, 0});
  const auto decode = [&](KarstNodeEntry &record) {
    return ExprMsh_UmshSingleStructure(nullptr, host::nodeRecordTable, data.data(),
                                       static_cast<uint32_t>(data.size()), "node", &record);
  };
  KarstNodeEntry record{};
  sim.failAt(Call::ExprMsh_UmshSingleStructure, 1);
  EXPECT_EQ(decode(record), EXPR_MSH_MALFORMED);
  EXPECT_EQ(record.majorVersionNum, 0u);
  EXPECT_EQ(decode(record), ZEL_OK);
  EXPECT_EQ(record.majorVersionNum, 7u);
  EXPECT_EQ(sim.faultsInjected(), 3u);
}

}  // namespace
