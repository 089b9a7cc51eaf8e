/* Spinlocks, worlds and threads over the system's own: what is promised, and what is fatal. */
#include <gmock/gmock.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <functional>
#include <latch>
#include <semaphore>
#include <thread>

#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/text.h"
#include "host/threads/spinlock.h"
#include "host/threads/sync.h"
#include "host/threads/worlds.h"
#include "platform/tolm.h"

using testing::ContainsRegex;
using testing::ElementsAre;

namespace {

using Body = std::function<void()>;

zel_HeapID newHeap(uint32_t size) {
  zel_HeapProps props{};
  host::fillName(&props.name, "test");
  props.maximumSize = size;
  zel_HeapID heap = ZEL_NO_HEAP;
  EXPECT_EQ(host::heapCreate(props, &heap), ZEL_OK);
  return heap;
}

zel_Status wait(uint32_t timeout = ZEL_TIMEOUT_NONE) {
  return zel_WorldWait(0, ZEL_NO_SPINLOCK, timeout, "for the test");
}

uint32_t runBody(void *body) {
  (*static_cast<Body *>(body))();
  return 0;
}

/* A heap, a domain and a lock; at its end nothing may be left alive. */
class Threads : public testing::Test {
 protected:
  Threads() : heap(newHeap(1 << 20)) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::configureWorlds({});
    const zel_Name name = lockProps("Test", 0).name;
    EXPECT_EQ(zel_LockDomainCreate(1, heap, &name, &domain), ZEL_OK);
    lock = newLock("First", 5);
    usedAtStart = used();
  }
  ~Threads() override {
    if (lock != ZEL_NO_SPINLOCK) zel_SpinlockDestroy(lock);
    if (domain != ZEL_NO_LOCK_DOMAIN) zel_LockDomainDestroy(domain);
    EXPECT_THAT(host::aliveWorldsAndLocks(), testing::IsEmpty());
    EXPECT_EQ(used(), 0u);
    host::heapDestroy(heap);
  }

  uint32_t used() const { return host::heapState(heap).used; }

  zel_SpinlockProps lockProps(const char *name, uint16_t rank) const {
    zel_SpinlockProps props{};
    props.heap = heap;
    host::fillName(&props.name, name);
    props.type = ZEL_SPINLOCK_RANKED;
    props.domain = domain;
    props.rank = rank;
    return props;
  }
  zel_SpinlockHandle newLock(const char *name, uint16_t rank) const {
    const zel_SpinlockProps props = lockProps(name, rank);
    zel_SpinlockHandle made = ZEL_NO_SPINLOCK;
    EXPECT_EQ(zel_SpinlockCreate(&props, &made), ZEL_OK);
    return made;
  }
  zel_WorldID start(const char *name, Body &body) const {
    zel_WorldID world = ZEL_NO_WORLD;
    EXPECT_EQ(TOLM_WorldCreate(&world, name, 1, runBody, &body, 1, heap), ZEL_OK);
    return world;
  }

  zel_HeapID heap;
  zel_LockDomainID domain = ZEL_NO_LOCK_DOMAIN;
  zel_SpinlockHandle lock = ZEL_NO_SPINLOCK;
  uint32_t usedAtStart = 0;
};

/* ---- Spinlocks ------------------------------------------------------------------------------- */

using Spinlocks = Threads;

TEST_F(Spinlocks, ExcludeEachOther) {
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
}

/* The last of two users destroys the lock right after its own unlock, while the other may still be
 * on its way out of its unlock. */
TEST_F(Spinlocks, MayBeDestroyedByTheirLastUserAtOnce) {
  for (int round = 0; round < 1'000; ++round) {
    const zel_SpinlockHandle shared = newLock("Shared", 1);
    EXPECT_EQ(used() - usedAtStart, zel_SpinlockAllocSize(ZEL_SPINLOCK_RANKED));
    int users = 2;
    const auto leave = [&] {
      zel_SpinlockLock(shared);
      const bool last = --users == 0;
      zel_SpinlockUnlock(shared);
      if (last) zel_SpinlockDestroy(shared);
    };
    {
      const std::jthread other(leave);
      leave();
    }
    EXPECT_EQ(used(), usedAtStart);
  }
}

TEST_F(Spinlocks, AreRefusedWithBadPropertiesOrWithoutMemory) {
  const zel_HeapID tiny = newHeap(16);
  const auto create = [&](uint32_t type, zel_HeapID from, zel_LockDomainID owner) {
    zel_SpinlockProps props = lockProps("Refused", 1);
    props.type = type;
    props.heap = from;
    props.domain = owner;
    zel_SpinlockHandle refused = 42;
    const zel_Status status = zel_SpinlockCreate(&props, &refused);
    EXPECT_EQ(refused, 42u);
    return status;
  };
  EXPECT_EQ(create(7, heap, domain), ZEL_BAD_PARAM);
  EXPECT_EQ(create(ZEL_SPINLOCK_RANKED, heap + 1000, domain), ZEL_BAD_PARAM);
  EXPECT_EQ(create(ZEL_SPINLOCK_RANKED, heap, ZEL_NO_LOCK_DOMAIN), ZEL_BAD_PARAM);
  EXPECT_EQ(create(ZEL_SPINLOCK_RANKED, tiny, domain), ZEL_NO_MEMORY);
  zel_WorldID world = 42;
  EXPECT_EQ(TOLM_WorldCreate(&world, "none", 1, runBody, nullptr, 1, tiny), ZEL_NO_MEMORY);
  EXPECT_EQ(world, 42u);
  host::heapDestroy(tiny);
}

TEST_F(Spinlocks, LeftBehindAreReportedByTheirDomainAndReleased) {
  std::vector<std::string> lines;
  host::setLogSink([&](const host::LogLine &line) { lines.push_back(line.text); }, true);
  newLock("Lost", 2);
  zel_SpinlockDestroy(std::exchange(lock, newLock("Second", 3)));
  zel_LockDomainDestroy(std::exchange(domain, ZEL_NO_LOCK_DOMAIN));
  lock = ZEL_NO_SPINLOCK;
  host::setLogSink({}, false);
  EXPECT_THAT(lines, testing::UnorderedElementsAre(ContainsRegex("Test.*Lost"),
                                                   ContainsRegex("Test.*Second")));
  EXPECT_EQ(used(), 0u);
}

/* ---- Preemption ------------------------------------------------------------------------------ */

class Preemption : public Threads {
 protected:
  /* Runs `holding` under the lock while another thread waits for it, known to its holder. */
  void holdWithWaiter(const Body &holding) {
    zel_SpinlockLock(lock);
    const std::jthread waiter([this] {
      zel_SpinlockLock(lock);
      EXPECT_FALSE(tolmapi_PreemptionIsPending()); /* now it is the holder, and nobody waits */
      zel_SpinlockUnlock(lock);
    });
    const host::Spinlock &record = host::lockOf(lock);
    while (record.waiters.load() == 0) std::this_thread::yield();
    holding();
    zel_SpinlockUnlock(lock);
  }
};

TEST_F(Preemption, IsDueOnceForAHolderBeyondTheSliceWhomSomebodyWaitsFor) {
  host::configureWorlds({.lockSlice = std::chrono::microseconds(0)});
  holdWithWaiter([] {
    while (!tolmapi_PreemptionIsPending()) std::this_thread::yield();
    EXPECT_FALSE(tolmapi_PreemptionIsPending()); /* one unit of work between two yes */
    EXPECT_TRUE(tolmapi_PreemptionIsPending());
    EXPECT_FALSE(tolmapi_PreemptionIsPending());
    std::thread([] { EXPECT_FALSE(tolmapi_PreemptionIsPending()); }).join();
  });
  /* A lock that changed hands is newly held, however long its waiters have been there. */
  host::Spinlock &record = host::lockOf(lock);
  zel_SpinlockLock(lock);
  EXPECT_FALSE(tolmapi_PreemptionIsPending());
  ++record.waiters; /* one that the lock was not asked about yet */
  EXPECT_FALSE(tolmapi_PreemptionIsPending());
  --record.waiters;
  zel_SpinlockUnlock(lock);
}

TEST_F(Preemption, IsNotDueWithinTheSlice) {
  host::configureWorlds({.lockSlice = std::chrono::hours(1)});
  holdWithWaiter([] { EXPECT_FALSE(tolmapi_PreemptionIsPending()); });
}

/* ---- Worlds ---------------------------------------------------------------------------------- */

using Worlds = Threads;

/* Somebody wakes them all the while, before and after their time too. */
TEST_F(Worlds, KnowTheirIDBeforeTheyRunAndLeaveNothingBehind) {
  std::atomic<zel_WorldID> target{ZEL_NO_WORLD};
  std::jthread waker([&](const std::stop_token &finished) {
    while (!finished.stop_requested()) zel_WorldForceWakeup(target);
  });
  for (int round = 0; round < 200; ++round) {
    zel_WorldID world = ZEL_NO_WORLD;
    zel_WorldID seen = ZEL_NO_WORLD;
    Body body = [&] {
      seen = std::atomic_ref(world).load();
      while (wait() == ZEL_OK) {
      }
    };
    ASSERT_EQ(TOLM_WorldCreate(&world, "brief", 1, runBody, &body, 1, heap), ZEL_OK);
    const zel_WorldID id = world;
    EXPECT_NE(id, target.exchange(id)) << "the last one's";
    EXPECT_GT(used(), usedAtStart); /* the record is the given heap's */
    TOLM_WorldDestroy(&world);
    EXPECT_EQ(seen, id);
    EXPECT_EQ(world, ZEL_NO_WORLD);
    EXPECT_EQ(used(), usedAtStart);
  }
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
  EXPECT_THAT(host::aliveWorldsAndLocks(),
              ElementsAre("world woken (waits: for the test)", "lock domain Test",
                          "lock First in domain Test"));
  const uint64_t activity = host::worldsActivity();
  zel_WorldForceWakeup(world);
  host::waitUntilWorldsIdle();
  EXPECT_EQ(returns, 2);
  EXPECT_GT(host::worldsActivity(), activity);
  TOLM_WorldDestroy(&world); /* stops it while it waits */
}

/* Queue under the lock, then wake: the way of every user. A lost wake-up leaves work undone at an
 * idle moment. */
TEST_F(Worlds, LoseNoWakeUpThatRacesTheWait) {
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
}

/* The world never sleeps, so the stop finds it running; a stop outlives the wait that reports it,
 * and a wake-up does not hide it. */
/* Put off, a wake-up is made at the end, when another world is woken, or when the thread blocks; never
 * lost, which this test would wait for in vain. */
TEST_F(Worlds, GetWakeUpsThatWerePutOff) {
  std::counting_semaphore<> woken(0);
  std::atomic<int> times{0};
  Body body = [&] {
    while (wait() == ZEL_OK) {
      ++times;
      woken.release();
    }
  };
  zel_WorldID one = start("one", body);
  zel_WorldID other = start("other", body);
  host::waitUntilWorldsIdle();
  {
    const host::WakeUpsPutOff putOff;
    zel_WorldForceWakeup(one);
    EXPECT_EQ(times, 0);
  }
  woken.acquire();
  host::waitUntilWorldsIdle();
  {
    const host::WakeUpsPutOff putOff;
    zel_WorldForceWakeup(one);
    zel_WorldForceWakeup(other);
    woken.acquire(); /* the first of them */
    zel_WorldSleep(0);
    woken.acquire();
  }
  host::waitUntilWorldsIdle();
  EXPECT_EQ(times, 3);
  TOLM_WorldDestroy(&one);
  TOLM_WorldDestroy(&other);
}

TEST_F(Worlds, StopAtEveryWaitAfterTheStop) {
  std::latch timedOut(1);
  zel_Status later = ZEL_OK;
  zel_WorldID world = ZEL_NO_WORLD;
  Body body = [&] {
    EXPECT_EQ(wait(1), ZEL_OK);
    timedOut.count_down();
    while (wait(0) == ZEL_OK) {
    }
    zel_WorldForceWakeup(std::atomic_ref(world).load());
    later = wait();
  };
  ASSERT_EQ(TOLM_WorldCreate(&world, "runner", 1, runBody, &body, 1, heap), ZEL_OK);
  timedOut.wait();
  TOLM_WorldDestroy(&world);
  EXPECT_EQ(later, ZEL_WORLD_STOPPING);
}

/* ---- What is fatal --------------------------------------------------------------------------- */

/* Found by its name in the backtrace of a world that hangs. */
extern "C" void takeBoth(zel_SpinlockHandle first, zel_SpinlockHandle second);
extern "C" [[gnu::noinline]] void takeBoth(zel_SpinlockHandle first, zel_SpinlockHandle second) {
  zel_SpinlockLock(first);
  zel_SpinlockLock(second);
  zel_SpinlockUnlock(second);
}

class ThreadsDeathTest : public Threads {
 protected:
  ThreadsDeathTest() : middle(newLock("Middle", 6)), high(newLock("High", 7)) {
    host::configureWorlds({.stopTimeout = std::chrono::milliseconds(20)});
  }
  ~ThreadsDeathTest() override {
    zel_SpinlockDestroy(middle);
    zel_SpinlockDestroy(high);
  }

  static void take(const std::vector<zel_SpinlockHandle> &locks) {
    std::for_each(locks.begin(), locks.end(), zel_SpinlockLock);
  }
  /* For bodies that must not come back. */
  void runToDeath(Body body) const {
    zel_WorldID world = start("Doomed", body);
    TOLM_WorldDestroy(&world);
  }

  zel_SpinlockHandle middle;
  zel_SpinlockHandle high;
};

TEST_F(ThreadsDeathTest, MistakesAreNamed) {
  struct Mistake {
    Body commit;
    const char *message;
  };
  const zel_SpinlockHandle equal = newLock("Equal", 5);
  const std::vector<Mistake> mistakes = {
      {[&] {
         take({lock, equal});
       },
       "spinlock \"Equal\" \\(rank 5\\) is taken while \"First\" \\(rank 5\\) is held"},
      {[&] {
         take({lock, middle, high});
         zel_SpinlockUnlock(middle); /* out of order: High is still held */
         zel_SpinlockLock(middle);
       },
       "\"Middle\" \\(rank 6\\) is taken while \"High\" \\(rank 7\\)"},
      {[&] {
         take({lock, high, lock});
       },
       "spinlock \"First\" \\(rank 5\\) is taken again by the thread that holds"},
      {[&] {
         pthread_setname_np(pthread_self(), "owner");
         zel_SpinlockLock(lock);
         host::Thread("thief", [&] { zel_SpinlockUnlock(lock); });
       },
       "spinlock \"First\" is unlocked by thread \"thief\".* held by thread \"owner\""},
      {[&] { zel_SpinlockUnlock(lock); }, "\"First\" .*nobody holds it"},
      {[&] { take({lock}), zel_SpinlockDestroy(lock); },
       "spinlock \"First\" is destroyed while thread"},
      {[&] { take({lock}), zel_WorldSleep(1); }, "sleeps .*\"First\""},
      {[&] { runToDeath([&] { zel_SpinlockLock(lock), wait(); }); },
       "waits \\(for the test\\) .*\"First\""},
      {[&] { runToDeath([&] { zel_SpinlockLock(lock); }); },
       "ends its world \\(Doomed\\) .*\"First\""},
      {[&] { runToDeath([] { zel_WorldWait(1, ZEL_NO_SPINLOCK, 1, "event"); }); },
       "\"Doomed\".*neither is served"},
      {[&] {
         zel_WorldID world = ZEL_NO_WORLD; /* known to the body from its first instruction on */
         Body body = [&] { TOLM_WorldDestroy(&world); };
         TOLM_WorldCreate(&world, "Suicidal", 1, runBody, &body, 1, heap);
         host::waitUntilWorldsIdle();
       },
       "\"Suicidal\".*destroys itself"},
  };
  for (const Mistake &mistake : mistakes) {
    EXPECT_DEATH(mistake.commit(), mistake.message);
  }
  zel_SpinlockDestroy(equal);
}

TEST_F(ThreadsDeathTest, AStopThatHangsSaysWhichWorldAndWhere) {
  const auto hang = [&] {
    std::latch held(1);
    std::thread([&] {
      zel_SpinlockLock(high);
      held.count_down();
      pause();
    }).detach();
    held.wait();
    runToDeath([&] {
      wait(1);
      takeBoth(lock, high);
    });
  };
  EXPECT_DEATH(hang(),
               "world \"Doomed\" .*does not stop within 20 ms \\(running, last wait: for the test"
               "\\)\n.*holds spinlock \"First\"\n.*waits for spinlock \"High\"\n(.*\n)*.*takeBoth");
}

}  // namespace
