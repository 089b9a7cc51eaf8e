/* Spinlocks, worlds and threads over the system's own: what is promised, and what is fatal. */
#include <gmock/gmock.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <latch>
#include <semaphore>
#include <set>
#include <thread>

#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/text.h"
#include "host/threads/spinlock.h"
#include "host/threads/sync.h"
#include "host/threads/worlds.h"
#include "platform/tolm.h"

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

namespace {

constexpr uint32_t kHeapSize = 1 << 20;

zel_Name nameOf(const char *text) {
  zel_Name name{};
  host::fillName(&name, text);
  return name;
}

zel_HeapID newHeap(uint32_t size) {
  zel_HeapProps props{};
  props.name = nameOf("test");
  props.maximumSize = size;
  zel_HeapID heap = ZEL_NO_HEAP;
  EXPECT_EQ(host::heapCreate(props, &heap), ZEL_OK);
  return heap;
}

/* A heap and a domain; at its end nothing may be left alive. */
class Threads : public testing::Test {
 protected:
  Threads() : heap(newHeap(kHeapSize)) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::configureWorlds({});
    const zel_Name name = nameOf("Test");
    EXPECT_EQ(zel_LockDomainCreate(1, heap, &name, &domain), ZEL_OK);
    usedAtStart = used();
  }
  ~Threads() override {
    if (domain != ZEL_NO_LOCK_DOMAIN) zel_LockDomainDestroy(domain);
    EXPECT_THAT(host::aliveWorldsAndLocks(), IsEmpty());
    EXPECT_EQ(used(), 0u);
    host::heapDestroy(heap);
  }

  uint32_t used() const { return host::heapState(heap).used; }

  zel_SpinlockProps lockProps(const char *name, uint16_t rank) const {
    zel_SpinlockProps props{};
    props.moduleID = 1;
    props.heap = heap;
    props.name = nameOf(name);
    props.type = ZEL_SPINLOCK_RANKED;
    props.domain = domain;
    props.rank = rank;
    return props;
  }
  zel_SpinlockHandle newLock(const char *name, uint16_t rank) const {
    const zel_SpinlockProps props = lockProps(name, rank);
    zel_SpinlockHandle lock = ZEL_NO_SPINLOCK;
    EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_OK);
    return lock;
  }

  zel_HeapID heap;
  zel_LockDomainID domain = ZEL_NO_LOCK_DOMAIN;
  uint32_t usedAtStart = 0;
};

/* ---- Spinlocks ------------------------------------------------------------------------------- */

using Spinlocks = Threads;

TEST_F(Spinlocks, ExcludeEachOther) {
  const zel_SpinlockHandle lock = newLock("Counter", 1);
  constexpr int kRounds = 50'000;
  int counter = 0; /* plain: only the lock guards it */
  const auto count = [&] {
    for (int i = 0; i < kRounds; ++i) {
      zel_SpinlockLock(lock);
      const int seen = counter;
      if (i % 64 == 0) std::this_thread::yield(); /* the others find the lock held */
      counter = seen + 1;
      zel_SpinlockUnlock(lock);
    }
  };
  { const std::jthread a(count), b(count), c(count), d(count); }
  EXPECT_EQ(counter, 4 * kRounds);
  zel_SpinlockDestroy(lock);
}

/* The last of two users destroys the lock right after its own unlock, while the other may still be
 * on its way out of its unlock. */
TEST_F(Spinlocks, MayBeDestroyedByTheirLastUserAtOnce) {
  for (int round = 0; round < 1'000; ++round) {
    const zel_SpinlockHandle lock = newLock("Shared", 1);
    int users = 2;
    const auto leave = [&] {
      zel_SpinlockLock(lock);
      const bool last = --users == 0;
      zel_SpinlockUnlock(lock);
      if (last) zel_SpinlockDestroy(lock);
    };
    const std::jthread other(leave);
    leave();
  }
  EXPECT_EQ(used(), usedAtStart);
}

TEST_F(Spinlocks, ConsumeWhatTheirSizeSays) {
  const zel_SpinlockHandle lock = newLock("Sized", 1);
  EXPECT_EQ(used() - usedAtStart, zel_SpinlockAllocSize(ZEL_SPINLOCK_RANKED));
  zel_SpinlockDestroy(lock);
  EXPECT_EQ(used(), usedAtStart);
}

TEST_F(Spinlocks, AreRefusedWithBadProperties) {
  zel_SpinlockHandle lock = 42;
  zel_SpinlockProps props = lockProps("Refused", 1);
  props.type = 7;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_BAD_PARAM);
  props = lockProps("Refused", 1);
  props.heap = heap + 1000;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_BAD_PARAM);
  props = lockProps("Refused", 1);
  props.domain = ZEL_NO_LOCK_DOMAIN;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_BAD_PARAM);
  EXPECT_EQ(lock, 42u);
}

TEST_F(Spinlocks, AreRefusedWithoutMemory) {
  const zel_HeapID tiny = newHeap(16);
  zel_SpinlockProps props = lockProps("Refused", 1);
  props.heap = tiny;
  zel_SpinlockHandle lock = 42;
  EXPECT_EQ(zel_SpinlockCreate(&props, &lock), ZEL_NO_MEMORY);
  zel_LockDomainID refused = 42;
  EXPECT_EQ(zel_LockDomainCreate(1, tiny, &props.name, &refused), ZEL_NO_MEMORY);
  EXPECT_EQ(lock, 42u);
  EXPECT_EQ(refused, 42u);
  host::heapDestroy(tiny);
}

TEST_F(Spinlocks, MayBeGivenBackInAnyOrder) {
  const zel_SpinlockHandle low = newLock("Low", 1), middle = newLock("Middle", 2),
                           high = newLock("High", 3);
  zel_SpinlockLock(low);
  zel_SpinlockLock(middle);
  zel_SpinlockUnlock(low);
  zel_SpinlockLock(high);
  zel_SpinlockUnlock(middle);
  zel_SpinlockUnlock(high);
  zel_SpinlockLock(low); /* nothing is held any more: the lowest rank may be taken */
  zel_SpinlockUnlock(low);
  for (const zel_SpinlockHandle lock : {low, middle, high}) zel_SpinlockDestroy(lock);
}

TEST_F(Spinlocks, LeftBehindAreReportedByTheirDomainAndReleased) {
  std::vector<std::string> lines;
  host::setLogSink([&](const host::LogLine &line) { lines.push_back(line.text); }, true);
  newLock("Forgotten", 1);
  zel_SpinlockDestroy(newLock("Remembered", 1));
  newLock("Lost", 2);
  EXPECT_THAT(host::aliveWorldsAndLocks(),
              testing::UnorderedElementsAre("lock domain Test", "lock Forgotten in domain Test",
                                            "lock Lost in domain Test"));
  zel_LockDomainDestroy(domain);
  domain = ZEL_NO_LOCK_DOMAIN;
  host::setLogSink({}, false);
  EXPECT_THAT(lines, testing::UnorderedElementsAre(AllOf(HasSubstr("Test"), HasSubstr("Forgotten")),
                                                   AllOf(HasSubstr("Test"), HasSubstr("Lost"))));
  EXPECT_EQ(used(), 0u);
}

/* ---- What is fatal with spinlocks ------------------------------------------------------------ */

class SpinlocksDeathTest : public Threads {
 protected:
  SpinlocksDeathTest() : first(newLock("First", 5)), second(newLock("Second", 5)) {}
  ~SpinlocksDeathTest() override {
    zel_SpinlockDestroy(first);
    zel_SpinlockDestroy(second);
  }
  zel_SpinlockHandle first;
  zel_SpinlockHandle second;
};

auto mentions(const std::vector<std::string> &texts) {
  return testing::ResultOf(
      [texts](const std::string &message) {
        std::vector<std::string> missing;
        for (const std::string &text : texts) {
          if (message.find(text) == std::string::npos) missing.push_back(text);
        }
        return missing;
      },
      IsEmpty());
}

TEST_F(SpinlocksDeathTest, RankEqual) {
  EXPECT_DEATH(
      (zel_SpinlockLock(first), zel_SpinlockLock(second)),
      mentions({"spinlock \"Second\" (rank 5) is taken while \"First\" (rank 5) is held"}));
}

TEST_F(SpinlocksDeathTest, RankBelow) {
  const zel_SpinlockHandle low = newLock("Low", 4);
  EXPECT_DEATH((zel_SpinlockLock(first), zel_SpinlockLock(low)),
               mentions({"\"Low\"", "\"First\""}));
  zel_SpinlockDestroy(low);
}

TEST_F(SpinlocksDeathTest, RankBelowOneHeldAfterAnUnlockOutOfOrder) {
  const zel_SpinlockHandle middle = newLock("Middle", 6), high = newLock("High", 7);
  EXPECT_DEATH(
      {
        zel_SpinlockLock(first);
        zel_SpinlockLock(middle);
        zel_SpinlockLock(high);
        zel_SpinlockUnlock(middle);
        zel_SpinlockLock(middle);
      },
      mentions({"\"Middle\" (rank 6)", "\"High\" (rank 7)"}));
  zel_SpinlockDestroy(middle);
  zel_SpinlockDestroy(high);
}

TEST_F(SpinlocksDeathTest, Recursion) {
  const zel_SpinlockHandle high = newLock("High", 6);
  EXPECT_DEATH((zel_SpinlockLock(first), zel_SpinlockLock(high), zel_SpinlockLock(first)),
               mentions({"spinlock \"First\" (rank 5) is taken again by the thread that holds"}));
  zel_SpinlockDestroy(high);
}

TEST_F(SpinlocksDeathTest, TooManyAtOnce) {
  std::vector<zel_SpinlockHandle> locks;
  for (uint16_t i = 0; i <= host::kMostLocksHeld; ++i) locks.push_back(newLock("Many", i));
  EXPECT_DEATH(std::for_each(locks.begin(), locks.end(), zel_SpinlockLock),
               mentions({"holds 16 locks already"}));
  std::for_each(locks.begin(), locks.end(), zel_SpinlockDestroy);
}

TEST_F(SpinlocksDeathTest, UnlockByAnotherThread) {
  EXPECT_DEATH(
      {
        pthread_setname_np(pthread_self(), "owner");
        zel_SpinlockLock(first);
        const std::jthread thief([&] {
          pthread_setname_np(pthread_self(), "thief");
          zel_SpinlockUnlock(first);
        });
      },
      mentions({"spinlock \"First\" is unlocked by thread \"thief\"", "held by thread \"owner\""}));
}

TEST_F(SpinlocksDeathTest, UnlockWithoutLock) {
  EXPECT_DEATH(zel_SpinlockUnlock(first), mentions({"\"First\"", "nobody holds it"}));
}

TEST_F(SpinlocksDeathTest, DestroyWhileHeld) {
  EXPECT_DEATH((zel_SpinlockLock(first), zel_SpinlockDestroy(first)),
               mentions({"spinlock \"First\" is destroyed while thread"}));
}

TEST_F(SpinlocksDeathTest, EndOfTheDomainWhileHeld) {
  EXPECT_DEATH(
      {
        zel_SpinlockLock(first);
        std::thread([&] { zel_LockDomainDestroy(domain); }).join();
      },
      mentions({"spinlock \"First\" is released with its domain while thread"}));
}

TEST_F(SpinlocksDeathTest, DomainDestroyedTwice) {
  EXPECT_DEATH(zel_LockDomainDestroy(12345), mentions({"there is none 0x3039"}));
}

TEST_F(SpinlocksDeathTest, SleepUnderALock) {
  EXPECT_DEATH((zel_SpinlockLock(first), zel_WorldSleep(1)), mentions({"sleeps", "\"First\""}));
}

TEST_F(SpinlocksDeathTest, ConditionWaitUnderALock) {
  EXPECT_DEATH(
      {
        host::Mutex mutex;
        host::Condition condition;
        std::unique_lock guard(mutex);
        zel_SpinlockLock(first);
        condition.wait(guard, {"for deliveries", true});
      },
      mentions({"waits (for deliveries)", "\"First\""}));
}

TEST_F(SpinlocksDeathTest, EndOfAThreadUnderALock) {
  EXPECT_DEATH(host::Thread("leaver", [&] { zel_SpinlockLock(first); }),
               mentions({"ends", "leaver", "\"First\""}));
}

/* ---- Preemption ------------------------------------------------------------------------------ */

class Preemption : public Threads {
 protected:
  Preemption() : lock(newLock("Wanted", 1)) {}
  ~Preemption() override { zel_SpinlockDestroy(lock); }

  /* Runs `holding` under the lock while another thread waits for it, known to its holder. */
  void holdWithWaiter(const std::function<void()> &holding) {
    zel_SpinlockLock(lock);
    const std::jthread waiter([this] {
      zel_SpinlockLock(lock);
      EXPECT_FALSE(tolmapi_PreemptionIsPending()); /* now it is the holder, and nobody waits */
      zel_SpinlockUnlock(lock);
    });
    const host::Spinlock &record = host::lockOf(lock);
    while (record.waitMark.load() == 0) std::this_thread::yield();
    holding();
    zel_SpinlockUnlock(lock);
  }

  zel_SpinlockHandle lock;
};

void untilPending() {
  while (!tolmapi_PreemptionIsPending()) std::this_thread::yield();
}

TEST_F(Preemption, IsDueWhenALockIsHeldBeyondTheSliceAndWanted) {
  host::configureWorlds({.lockSlice = std::chrono::microseconds(0)});
  holdWithWaiter([] {
    untilPending();
    EXPECT_FALSE(tolmapi_PreemptionIsPending()); /* one unit of work between two yes */
    EXPECT_TRUE(tolmapi_PreemptionIsPending());
    EXPECT_FALSE(tolmapi_PreemptionIsPending());
  });
}

TEST_F(Preemption, IsNotDueWithinTheSlice) {
  host::configureWorlds({.lockSlice = std::chrono::hours(1)});
  holdWithWaiter([] { EXPECT_FALSE(tolmapi_PreemptionIsPending()); });
}

TEST_F(Preemption, IsNotDueWithoutAWaiter) {
  host::configureWorlds({.lockSlice = std::chrono::microseconds(0)});
  EXPECT_FALSE(tolmapi_PreemptionIsPending());
  zel_SpinlockLock(lock);
  const uint64_t start = zel_TimerTCToNS(zel_GetTimerCycles());
  while (zel_TimerTCToNS(zel_GetTimerCycles()) < start + 10'000) {
    EXPECT_FALSE(tolmapi_PreemptionIsPending());
  }
  zel_SpinlockUnlock(lock);
}

/* A lock that changed hands is newly held, however long its waiters have been there. */
TEST_F(Preemption, TimesEachHoldAnew) {
  host::configureWorlds({.lockSlice = std::chrono::microseconds(0)});
  holdWithWaiter(untilPending);
  EXPECT_FALSE(tolmapi_PreemptionIsPending());
  host::Spinlock &record = host::lockOf(lock);
  zel_SpinlockLock(lock);
  ++record.waiters; /* one that has not got to look at the clock yet */
  EXPECT_FALSE(tolmapi_PreemptionIsPending());
  --record.waiters;
  zel_SpinlockUnlock(lock);
}

TEST_F(Preemption, AsksTheHolderOnlyNotOthers) {
  host::configureWorlds({.lockSlice = std::chrono::microseconds(0)});
  holdWithWaiter([] {
    untilPending();
    std::thread([] { EXPECT_FALSE(tolmapi_PreemptionIsPending()); }).join();
  });
}

/* ---- Worlds ---------------------------------------------------------------------------------- */

class Worlds : public Threads {
 protected:
  using Body = std::function<void()>;

  static uint32_t run(void *body) {
    (*static_cast<Body *>(body))();
    return 0;
  }
  zel_WorldID start(const char *name, Body &body) const {
    zel_WorldID world = ZEL_NO_WORLD;
    EXPECT_EQ(TOLM_WorldCreate(&world, name, 1, run, &body, 1, heap), ZEL_OK);
    EXPECT_NE(world, ZEL_NO_WORLD);
    return world;
  }
  static zel_Status wait(uint32_t timeout = ZEL_TIMEOUT_NONE) {
    return zel_WorldWait(0, ZEL_NO_SPINLOCK, timeout, "for the test");
  }
};

TEST_F(Worlds, KnowTheirIDBeforeTheyRun) {
  for (int round = 0; round < 100; ++round) {
    zel_WorldID world = ZEL_NO_WORLD;
    zel_WorldID seen = ZEL_NO_WORLD;
    Body body = [&] { seen = std::atomic_ref(world).load(std::memory_order_acquire); };
    ASSERT_EQ(TOLM_WorldCreate(&world, "early", 1, run, &body, 1, heap), ZEL_OK);
    const zel_WorldID id = world;
    TOLM_WorldDestroy(&world);
    EXPECT_EQ(seen, id);
    EXPECT_EQ(world, ZEL_NO_WORLD);
  }
}

TEST_F(Worlds, LeaveNothingBehindAndNeverReuseAnIDSoon) {
  std::set<zel_WorldID> ids;
  Body body = [] {};
  for (int round = 0; round < 100; ++round) {
    zel_WorldID world = start("short", body);
    EXPECT_TRUE(ids.insert(world).second);
    EXPECT_GT(used(), usedAtStart); /* the record is the given heap's */
    TOLM_WorldDestroy(&world);
    EXPECT_EQ(used(), usedAtStart);
  }
}

TEST_F(Worlds, WithoutMemoryLeaveTheIDAlone) {
  const zel_HeapID tiny = newHeap(16);
  Body body = [] { ADD_FAILURE() << "runs"; };
  zel_WorldID world = 42;
  EXPECT_EQ(TOLM_WorldCreate(&world, "none", 1, run, &body, 1, tiny), ZEL_NO_MEMORY);
  EXPECT_EQ(world, 42u);
  host::heapDestroy(tiny);
}

TEST_F(Worlds, ThatWereNeverCreatedMayBeDestroyed) {
  zel_WorldID world = ZEL_NO_WORLD;
  TOLM_WorldDestroy(&world);
  EXPECT_EQ(world, ZEL_NO_WORLD);
}

TEST_F(Worlds, AreThreadsWithNames) {
  char name[16] = {};
  Body body = [&] { pthread_getname_np(pthread_self(), name, sizeof name); };
  zel_WorldID world = start("KARSTResolverCache", body);
  TOLM_WorldDestroy(&world);
  EXPECT_STREQ(name, "KARSTResolverCa");
}

TEST_F(Worlds, KeepAWakeUpUntilTheNextWaitAndUseItUp) {
  std::binary_semaphore begin(0);
  std::atomic<int> returns{0};
  Body body = [&] {
    begin.acquire();
    while (wait() == ZEL_OK) ++returns;
  };
  zel_WorldID world = start("woken", body);
  zel_WorldForceWakeup(world);
  zel_WorldForceWakeup(world); /* two before the wait are one */
  begin.release();
  host::waitUntilWorldsIdle();
  EXPECT_EQ(returns, 1);
  zel_WorldForceWakeup(world);
  host::waitUntilWorldsIdle();
  EXPECT_EQ(returns, 2);
  TOLM_WorldDestroy(&world);
}

/* Queue under the lock, then wake: the way of every user. A lost wake-up leaves work undone at an
 * idle moment. */
TEST_F(Worlds, LoseNoWakeUpThatRacesTheWait) {
  const zel_SpinlockHandle lock = newLock("Queue", 1);
  int queued = 0;
  int done = 0;
  Body body = [&] {
    do {
      zel_SpinlockLock(lock);
      done += std::exchange(queued, 0);
      zel_SpinlockUnlock(lock);
    } while (wait() == ZEL_OK);
  };
  zel_WorldID world = start("worker", body);
  for (int round = 1; round <= 5'000; ++round) {
    for (int i = 0; i < 2; ++i) {
      zel_SpinlockLock(lock);
      ++queued;
      zel_WorldForceWakeup(world); /* allowed under the lock */
      zel_SpinlockUnlock(lock);
    }
    host::waitUntilWorldsIdle();
    ASSERT_EQ(done, 2 * round);
  }
  TOLM_WorldDestroy(&world);
  zel_SpinlockDestroy(lock);
}

TEST_F(Worlds, StopWhileTheyWait) {
  zel_Status status = ZEL_OK;
  Body body = [&] { status = wait(); };
  zel_WorldID world = start("waiter", body);
  host::waitUntilWorldsIdle();
  TOLM_WorldDestroy(&world);
  EXPECT_EQ(status, ZEL_WORLD_STOPPING);
}

/* The world never sleeps, so the stop finds it running; a stop outlives the wait that reports it,
 * and a wake-up does not hide it. */
TEST_F(Worlds, StopAtEveryWaitAfterTheStop) {
  std::latch running(1);
  zel_Status later = ZEL_OK;
  zel_WorldID world = ZEL_NO_WORLD;
  Body body = [&] {
    running.count_down();
    while (wait(0) == ZEL_OK) {
    }
    zel_WorldForceWakeup(std::atomic_ref(world).load());
    later = wait();
  };
  ASSERT_EQ(TOLM_WorldCreate(&world, "runner", 1, run, &body, 1, heap), ZEL_OK);
  running.wait();
  TOLM_WorldDestroy(&world);
  EXPECT_EQ(later, ZEL_WORLD_STOPPING);
}

TEST_F(Worlds, WaitNoLongerThanTheirTimeout) {
  zel_Status status = ZEL_FAILURE;
  std::binary_semaphore timedOut(0);
  Body body = [&] {
    status = wait(1);
    timedOut.release();
  };
  zel_WorldID world = start("patient", body);
  timedOut.acquire();
  EXPECT_EQ(status, ZEL_OK);
  TOLM_WorldDestroy(&world);
}

TEST_F(Worlds, IgnoreWakeUpsOfWorldsThatEnd) {
  zel_WorldForceWakeup(ZEL_NO_WORLD);
  zel_WorldForceWakeup(0xfffffff0);
  std::atomic<zel_WorldID> target{ZEL_NO_WORLD};
  std::atomic<bool> finished{false};
  const std::jthread waker([&] {
    while (!finished) zel_WorldForceWakeup(target);
  });
  Body body = [] {
    while (wait() == ZEL_OK) {
    }
  };
  for (int round = 0; round < 200; ++round) {
    zel_WorldID world = start("brief", body);
    target = world;
    TOLM_WorldDestroy(&world);
  }
  finished = true;
}

TEST_F(Worlds, ActivityStandsStillExactlyWhileNothingRuns) {
  Body body = [] {
    while (wait() == ZEL_OK) {
    }
  };
  zel_WorldID world = start("active", body);
  host::waitUntilWorldsIdle();
  const uint64_t before = host::worldsActivity();
  host::waitUntilWorldsIdle();
  EXPECT_EQ(host::worldsActivity(), before);
  zel_WorldForceWakeup(world);
  host::waitUntilWorldsIdle();
  EXPECT_GT(host::worldsActivity(), before);
  TOLM_WorldDestroy(&world);
}

TEST_F(Worlds, TellWhatTheyDo) {
  std::binary_semaphore finish(0);
  std::latch running(1);
  Body waiting = [] { wait(); };
  Body busy = [&] {
    running.count_down();
    finish.acquire();
  };
  zel_WorldID first = start("First", waiting);
  host::waitUntilWorldsIdle();
  zel_WorldID second = start("Second", busy);
  running.wait();
  EXPECT_THAT(host::aliveWorldsAndLocks(),
              ElementsAre("world First (waits: for the test)", "world Second (running)",
                          "lock domain Test"));
  finish.release();
  host::waitUntilWorldsIdle();
  EXPECT_THAT(host::aliveWorldsAndLocks(), testing::Contains("world Second (ended)"));
  TOLM_WorldDestroy(&second);
  TOLM_WorldDestroy(&first);
}

TEST_F(Worlds, PlainThreadsSleepToo) {
  const uint64_t start = zel_TimerTCToNS(zel_GetTimerCycles());
  zel_WorldSleep(1'000);
  EXPECT_GE(zel_TimerTCToNS(zel_GetTimerCycles()) - start, 1'000'000u);
}

TEST_F(Worlds, RunOnAProcessorThatExists) {
  EXPECT_LT(tolmapi_GetPCPUNumPreemptible(), sysconf(_SC_NPROCESSORS_CONF));
}

/* ---- What is fatal with worlds --------------------------------------------------------------- */

class WorldsDeathTest : public Worlds {
 protected:
  /* For bodies that must not come back. */
  void runToDeath(Body body) {
    zel_WorldID world = start("Doomed", body);
    TOLM_WorldDestroy(&world);
  }
};

/* A world in a loop of its own, found by its name in the backtrace. */
extern "C" void hangForEver(std::latch *running);
extern "C" [[gnu::noinline]] void hangForEver(std::latch *running) {
  running->count_down();
  for (std::atomic<bool> never{false}; !never;) std::this_thread::yield();
}

TEST_F(WorldsDeathTest, AStopThatHangsSaysWhichWorldAndWhere) {
  const zel_SpinlockHandle lock = newLock("Held", 1);
  EXPECT_DEATH(
      {
        host::configureWorlds({.stopTimeout = std::chrono::milliseconds(20)});
        std::latch running(1);
        Body body = [&] {
          wait(1);
          zel_SpinlockLock(lock);
          hangForEver(&running);
        };
        zel_WorldID world = start("Stuck", body);
        running.wait();
        TOLM_WorldDestroy(&world);
      },
      mentions({"world \"Stuck\"", "does not stop within 20 ms", "running, last wait: for the test",
                "holds spinlock \"Held\"", "hangForEver"}));
  zel_SpinlockDestroy(lock);
}

TEST_F(WorldsDeathTest, AStopThatHangsInALockSaysWhichLock) {
  const zel_SpinlockHandle lock = newLock("Wanted", 1);
  EXPECT_DEATH(
      {
        host::configureWorlds({.stopTimeout = std::chrono::milliseconds(20)});
        std::latch held(1);
        std::thread([&] {
          zel_SpinlockLock(lock);
          held.count_down();
          pause();
        }).detach();
        held.wait();
        runToDeath([&] { zel_SpinlockLock(lock); });
      },
      mentions({"world \"Doomed\"", "waits for spinlock \"Wanted\""}));
  zel_SpinlockDestroy(lock);
}

TEST_F(WorldsDeathTest, WaitUnderALock) {
  const zel_SpinlockHandle lock = newLock("Carried", 1);
  EXPECT_DEATH(runToDeath([&] {
                 zel_SpinlockLock(lock);
                 wait();
               }),
               mentions({"waits (for the test)", "\"Carried\""}));
  zel_SpinlockDestroy(lock);
}

TEST_F(WorldsDeathTest, EndUnderALock) {
  const zel_SpinlockHandle lock = newLock("Carried", 1);
  EXPECT_DEATH(runToDeath([&] { zel_SpinlockLock(lock); }),
               mentions({"ends its world (Doomed)", "\"Carried\""}));
  zel_SpinlockDestroy(lock);
}

TEST_F(WorldsDeathTest, DestroyUnderALock) {
  const zel_SpinlockHandle lock = newLock("Carried", 1);
  Body body = [] {};
  EXPECT_DEATH(
      {
        zel_WorldID world = start("Other", body);
        zel_SpinlockLock(lock);
        TOLM_WorldDestroy(&world);
      },
      mentions({"destroys a world", "\"Carried\""}));
  zel_SpinlockDestroy(lock);
}

TEST_F(WorldsDeathTest, WaitByAThreadThatIsNoWorld) {
  EXPECT_DEATH(wait(), mentions({"for the test", "is none"}));
}

TEST_F(WorldsDeathTest, WaitForAnEvent) {
  EXPECT_DEATH(runToDeath([] { zel_WorldWait(1, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "event"); }),
               mentions({"\"Doomed\"", "neither is served"}));
}

TEST_F(WorldsDeathTest, DestroyOfAWorldThatDoesNotExist) {
  zel_WorldID world = 0xfffffff0;
  EXPECT_DEATH(TOLM_WorldDestroy(&world), mentions({"world 4294967280", "does not exist"}));
}

TEST_F(WorldsDeathTest, DestroyOfItself) {
  EXPECT_DEATH(
      {
        zel_WorldID world = ZEL_NO_WORLD;
        Body body = [&] { TOLM_WorldDestroy(&world); };
        TOLM_WorldCreate(&world, "Suicidal", 1, run, &body, 1, heap);
        host::waitUntilWorldsIdle();
      },
      mentions({"\"Suicidal\"", "destroys itself"}));
}

TEST_F(WorldsDeathTest, WaitForIdleWorldsInAWorld) {
  EXPECT_DEATH(runToDeath(host::waitUntilWorldsIdle),
               mentions({"\"Doomed\"", "itself among them"}));
}

/* ---- The host's own threads ------------------------------------------------------------------ */

TEST_F(Threads, HandWorkOverThroughAMutexAndACondition) {
  host::Mutex mutex;
  host::Condition changed;
  constexpr int kItems = 5'000;
  int queued = 0;
  int taken = 0;
  {
    const host::Thread taker("taker", [&] {
      std::unique_lock guard(mutex);
      while (taken < kItems) {
        while (queued == 0) changed.wait(guard, {"for items", true});
        taken += std::exchange(queued, 0);
        changed.notifyAll();
      }
    });
    std::unique_lock guard(mutex);
    for (int i = 0; i < kItems; ++i) {
      while (queued == 2) changed.wait(guard, {"for room", false});
      ++queued;
      changed.notifyOne();
    }
  } /* joins */
  EXPECT_EQ(taken, kItems);
}

TEST_F(Threads, CarryTheirNames) {
  char name[16] = {};
  {
    const host::Thread thread("directory delivery 1",
                              [&] { pthread_getname_np(pthread_self(), name, sizeof name); });
  }
  EXPECT_STREQ(name, "directory deliv");
}

}  // namespace
