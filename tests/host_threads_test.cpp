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
#include "host/kernel/text.h"
#include "host/threads/sync.h"
#include "host/threads/worlds.h"
#include "platform/tolm.h"
#include "tests/log_lines.h"
#include "tests/test_heap.h"

using testing::ContainsRegex;

namespace {

using Body = std::function<void()>;
using Locks = std::vector<zel_SpinlockHandle>;

zel_Status wait(uint32_t timeout = ZEL_TIMEOUT_NONE) {
  return zel_WorldWait(0, ZEL_NO_SPINLOCK, timeout, "for the test");
}

/* With a first lock; at its end nothing may be left alive. */
class Threads : public testing::Test, protected TestLocks {
 protected:
  Threads() {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    host::configureWorlds({});
  }
  ~Threads() override {
    if (lock != ZEL_NO_SPINLOCK) zel_SpinlockDestroy(lock);
    end();
    EXPECT_THAT(host::aliveWorldsAndLocks(), testing::IsEmpty());
    EXPECT_EQ(used(), 0u);
  }

  uint32_t used() const { return host::heapState(id).used; }

  static zel_Status start(zel_WorldID &world, const char *name, Body &body, zel_HeapID from) {
    const auto run = [](void *data) { return (*static_cast<Body *>(data))(), 0u; };
    return TOLM_WorldCreate(&world, name, 1, run, &body, 1, from);
  }
  zel_WorldID start(const char *name, Body &body) const {
    zel_WorldID world = ZEL_NO_WORLD;
    EXPECT_EQ(start(world, name, body, id), ZEL_OK);
    return world;
  }

  zel_SpinlockHandle lock = make("First", 5);
  const uint32_t usedAtStart = used();
};

/* ---- Spinlocks ------------------------------------------------------------------------------- */

using Spinlocks = Threads;

/* The last of four users destroys the lock right after its own unlock, while another may still be on
 * its way out of its unlock. */
TEST_F(Spinlocks, ExcludeEachOtherAndMayBeDestroyedByTheirLastUserAtOnce) {
  constexpr int kRounds = 500, kEach = 100;
  for (int round = 0; round < kRounds; ++round) {
    const zel_SpinlockHandle shared = make("Shared", 1);
    EXPECT_EQ(used() - usedAtStart, zel_SpinlockAllocSize(ZEL_SPINLOCK_RANKED));
    int counter = 0; /* plain: only the lock guards it */
    const auto count = [&] {
      for (int mine = 1, all = 0; mine <= kEach; ++mine) {
        zel_SpinlockLock(shared);
        const int seen = counter;
        if (mine % 64 == 0) std::this_thread::yield(); /* the others find the lock held */
        counter = all = seen + 1;
        zel_SpinlockUnlock(shared);
        if (all == 4 * kEach) zel_SpinlockDestroy(shared);
      }
    };
    { const std::jthread a(count), b(count), c(count), d(count); }
    ASSERT_EQ(counter, 4 * kEach);
    ASSERT_EQ(used(), usedAtStart);
  }
}

TEST_F(Spinlocks, AreRefusedWithoutMemoryAsWorldsAre) {
  const TestHeap tiny(16);
  zel_SpinlockProps refused = props("Refused", 1);
  zel_SpinlockHandle untouched = 42;
  zel_WorldID world = 42;
  Body none;
  refused.heap = tiny.id;
  EXPECT_EQ(zel_SpinlockCreate(&refused, &untouched), ZEL_NO_MEMORY);
  EXPECT_EQ(start(world, "none", none, tiny.id), ZEL_NO_MEMORY);
  EXPECT_EQ(untouched, 42u);
  EXPECT_EQ(world, 42u);
}

TEST_F(Spinlocks, LeftBehindAreReportedByTheirDomainAndReleased) {
  const LogLines log;
  end();
  lock = ZEL_NO_SPINLOCK;
  EXPECT_THAT(log.texts, testing::ElementsAre(ContainsRegex("test.*First")));
  EXPECT_EQ(used(), 0u);
}

TEST_F(Spinlocks, AskTheirHolderToGiveWayWhileSomebodyWaitsButNotTwiceRunning) {
  host::configureWorlds({.lockSlice = std::chrono::microseconds(0)});
  zel_SpinlockLock(lock);
  EXPECT_FALSE(tolmapi_PreemptionIsPending()) << "nobody waits";
  const std::jthread waiter([this] {
    zel_SpinlockLock(lock);
    zel_SpinlockUnlock(lock);
  });
  while (!tolmapi_PreemptionIsPending()) std::this_thread::yield();
  EXPECT_FALSE(tolmapi_PreemptionIsPending()) << "one unit of work between two yes";
  zel_SpinlockUnlock(lock);
}

/* ---- Worlds ---------------------------------------------------------------------------------- */

using Worlds = Threads;

/* Somebody wakes them all the while, before and after their time too. The stop finds a world that
 * never sleeps; it outlives the wait that reports it, and a wake-up does not hide it. */
TEST_F(Worlds, KnowTheirIDBeforeTheyRunStopAtEveryWaitAndLeaveNothingBehind) {
  std::atomic<zel_WorldID> target{ZEL_NO_WORLD};
  std::jthread waker([&](const std::stop_token &finished) {
    while (!finished.stop_requested()) zel_WorldForceWakeup(target);
  });
  for (int round = 0; round < 200; ++round) {
    zel_WorldID world = ZEL_NO_WORLD, seen = ZEL_NO_WORLD;
    zel_Status last = ZEL_OK;
    Body body = [&] {
      seen = std::atomic_ref(world).load();
      while (wait(0) == ZEL_OK) {
      }
      zel_WorldForceWakeup(seen);
      last = wait();
    };
    ASSERT_EQ(start(world, "brief", body, id), ZEL_OK);
    const zel_WorldID created = world;
    EXPECT_NE(created, target.exchange(created)) << "the last one's";
    EXPECT_GT(used(), usedAtStart); /* the record is the given heap's */
    TOLM_WorldDestroy(&world);
    EXPECT_EQ(std::tuple(seen, last, world, used()),
              std::tuple(created, ZEL_WORLD_STOPPING, ZEL_NO_WORLD, usedAtStart));
  }
}

/* A wake-up that is lost lets the world idle in its first wait; one that is not used up, in none. */
TEST_F(Worlds, KeepAWakeUpThatComesBeforeTheWaitForOneWait) {
  zel_WorldID world = ZEL_NO_WORLD;
  zel_Status first = ZEL_OK, second = ZEL_OK;
  Body body = [&] {
    zel_WorldForceWakeup(std::atomic_ref(world));
    first = wait();
    second = wait();
  };
  start(world, "woken", body, id);
  host::waitUntilWorldsIdle();
  TOLM_WorldDestroy(&world);
  EXPECT_EQ(std::pair(first, second),
            std::pair(zel_Status{ZEL_OK}, zel_Status{ZEL_WORLD_STOPPING}));
}

/* Put off, a wake-up is made at the end, when another world is woken, or when the thread blocks; never
 * lost, which this test would wait for in vain. */
TEST_F(Worlds, GetWakeUpsThatWerePutOff) {
  std::counting_semaphore<> woken(0);
  Body body = [&] {
    for (; wait() == ZEL_OK; woken.release()) {
    }
  };
  zel_WorldID one = start("one", body), other = start("other", body);
  host::waitUntilWorldsIdle();
  {
    const host::WakeUpsPutOff putOff;
    zel_WorldForceWakeup(one);
    zel_WorldForceWakeup(other);
    woken.acquire(); /* the first of them */
    zel_WorldSleep(0);
    woken.acquire();
    zel_WorldForceWakeup(one);
  }
  woken.acquire();
  for (zel_WorldID *world : {&one, &other}) TOLM_WorldDestroy(world);
}

/* ---- What is fatal --------------------------------------------------------------------------- */

/* Found by its name in the backtrace of a world that hangs. */
extern "C" [[gnu::noinline]] void takeAll(const Locks &locks) {
  for (const zel_SpinlockHandle lock : locks) zel_SpinlockLock(lock);
}

class ThreadsDeathTest : public Threads {
 protected:
  ThreadsDeathTest() { host::configureWorlds({.stopTimeout = std::chrono::milliseconds(20)}); }

  /* For bodies that must not come back. */
  void runToDeath(Body body) const {
    zel_WorldID world = start("Doomed", body);
    TOLM_WorldDestroy(&world);
  }

  const zel_SpinlockHandle equal = keep("Equal", 5), middle = keep("Middle", 6),
                           high = keep("High", 7);
};

TEST_F(ThreadsDeathTest, MistakesAreNamed) {
  const std::vector<std::pair<Body, const char *>> mistakes = {
      {[&] {
         takeAll({lock, equal});
       },
       "spinlock \"Equal\" \\(rank 5\\) is taken while \"First\" \\(rank 5\\) is held"},
      {[&] {
         takeAll({lock, middle, high});
         zel_SpinlockUnlock(middle); /* out of order: High is still held */
         zel_SpinlockLock(middle);
       },
       "\"Middle\" \\(rank 6\\) is taken while \"High\" \\(rank 7\\)"},
      {[&] {
         takeAll({lock, high, lock});
       },
       "spinlock \"First\" \\(rank 5\\) is taken again by the thread that holds"},
      {[&] {
         pthread_setname_np(pthread_self(), "owner");
         zel_SpinlockLock(lock);
         host::Thread("thief", [&] { zel_SpinlockUnlock(lock); });
       },
       "spinlock \"First\" is unlocked by thread \"thief\".* held by thread \"owner\""},
      {[&] { zel_SpinlockLock(lock), zel_SpinlockDestroy(lock); },
       "spinlock \"First\" is destroyed while thread"},
      {[&] { runToDeath([&] { zel_SpinlockLock(lock), wait(); }); },
       "waits \\(for the test\\) .*\"First\""},
      {[&] {
         std::latch held(1);
         std::thread([&] {
           zel_SpinlockLock(high);
           held.count_down();
           pause();
         }).detach();
         held.wait();
         runToDeath([&] {
           wait(1);
           takeAll({lock, high});
         });
       },
       "world \"Doomed\" .*does not stop within 20 ms \\(running, last wait: for the test"
       "\\)\n.*holds spinlock \"First\"\n.*waits for spinlock \"High\"\n(.*\n)*.*takeAll"},
  };
  for (const auto &[commit, message] : mistakes) EXPECT_DEATH(commit(), message);
}

}  // namespace
