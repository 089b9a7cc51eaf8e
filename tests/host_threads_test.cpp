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

using testing::ContainsRegex;

namespace {

using Body = std::function<void()>;
using Locks = std::vector<zel_SpinlockHandle>;

zel_HeapID newHeap(uint32_t size) {
  zel_HeapProps props{};
  props.maximumSize = size;
  zel_HeapID heap = ZEL_NO_HEAP;
  EXPECT_EQ(host::heapCreate(props, &heap), ZEL_OK);
  return heap;
}

zel_Status wait(uint32_t timeout = ZEL_TIMEOUT_NONE) {
  return zel_WorldWait(0, ZEL_NO_SPINLOCK, timeout, "for the test");
}

/* A heap, a domain and a lock; at its end nothing may be left alive. */
class Threads : public testing::Test {
 protected:
  Threads() {
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
  static zel_Status start(zel_WorldID &world, const char *name, Body &body, zel_HeapID from) {
    const auto run = [](void *data) { return (*static_cast<Body *>(data))(), 0u; };
    return TOLM_WorldCreate(&world, name, 1, run, &body, 1, from);
  }
  zel_WorldID start(const char *name, Body &body) const {
    zel_WorldID world = ZEL_NO_WORLD;
    EXPECT_EQ(start(world, name, body, heap), ZEL_OK);
    return world;
  }

  zel_HeapID heap = newHeap(1 << 20);
  zel_LockDomainID domain = ZEL_NO_LOCK_DOMAIN;
  zel_SpinlockHandle lock = ZEL_NO_SPINLOCK;
  uint32_t usedAtStart = 0;
};

/* ---- Spinlocks ------------------------------------------------------------------------------- */

using Spinlocks = Threads;

/* The last of four users destroys the lock right after its own unlock, while another may still be on
 * its way out of its unlock. */
TEST_F(Spinlocks, ExcludeEachOtherAndMayBeDestroyedByTheirLastUserAtOnce) {
  constexpr int kRounds = 500, kEach = 100;
  for (int round = 0; round < kRounds; ++round) {
    const zel_SpinlockHandle shared = newLock("Shared", 1);
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
  zel_SpinlockProps props = lockProps("Refused", 1);
  zel_SpinlockHandle untouched = 42;
  zel_WorldID world = 42;
  Body none;
  props.heap = newHeap(16);
  EXPECT_EQ(zel_SpinlockCreate(&props, &untouched), ZEL_NO_MEMORY);
  EXPECT_EQ(start(world, "none", none, props.heap), ZEL_NO_MEMORY);
  EXPECT_EQ(untouched, 42u);
  EXPECT_EQ(world, 42u);
  host::heapDestroy(props.heap);
}

TEST_F(Spinlocks, LeftBehindAreReportedByTheirDomainAndReleased) {
  const LogLines log;
  zel_LockDomainDestroy(std::exchange(domain, ZEL_NO_LOCK_DOMAIN));
  lock = ZEL_NO_SPINLOCK;
  EXPECT_THAT(log.texts, testing::ElementsAre(ContainsRegex("Test.*First")));
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
    ASSERT_EQ(start(world, "brief", body, heap), ZEL_OK);
    const zel_WorldID id = world;
    EXPECT_NE(id, target.exchange(id)) << "the last one's";
    EXPECT_GT(used(), usedAtStart); /* the record is the given heap's */
    TOLM_WorldDestroy(&world);
    EXPECT_EQ(std::tuple(seen, last, world, used()),
              std::tuple(id, ZEL_WORLD_STOPPING, ZEL_NO_WORLD, usedAtStart));
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
  start(world, "woken", body, heap);
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
  ~ThreadsDeathTest() override { std::for_each(more.begin(), more.end(), zel_SpinlockDestroy); }

  /* For bodies that must not come back. */
  void runToDeath(Body body) const {
    zel_WorldID world = start("Doomed", body);
    TOLM_WorldDestroy(&world);
  }

  const Locks more{newLock("Equal", 5), newLock("Middle", 6), newLock("High", 7)};
  const zel_SpinlockHandle equal = more[0], middle = more[1], high = more[2];
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
