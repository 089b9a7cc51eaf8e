/* The recorder of memory accesses: each thing that it must find is found in small instrumented code,
 * and what is right goes through.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "host/kernel/log.h"
#include "host/kernel/text.h"
#include "host/threads/sync.h"
#include "platform/tolm.h"
#include "sim/access/recorder.h"
#include "sim/lock_order.h"
#include "sim/simulation.h"
#include "tests/sim_access_subject.h"
#include "tests/sim_heap.h"

namespace {

using sim::Machine;
using sim::Simulation;
using sim::Switching;
using sim::access::Guard;
using sim::access::Structure;
using testing::AllOf;
using testing::HasSubstr;

using Body = std::function<void()>;

using subject::flag;
using subject::shared;

/* Plays the bodies on fibers "a", "b", ... one behind the other, with nothing between them that
 * would make one happen before the next. */
void play(const std::vector<Body> &bodies) {
  Machine machine;
  machine.watch();
  flag = 0;
  char name = 'a';
  for (const Body &body : bodies) machine.spawn(std::string(1, name++), body);
  machine.run();
}

void put() {
  subject::store(&shared[0], 1);
}
void get() {
  subject::load(&shared[0]);
}

/* A machine that is watched, with a heap. */
struct Bench {
  Machine machine;
  sim::access::Recorder &recorder = machine.watch();
  SimHeap heap;
};

/* ---- Races ----------------------------------------------------------------------------------- */

constexpr const char *race = "a race: neither of two accesses happens before the other";

void putAtomically() {
  subject::atomicStore(&shared[0], 1, __ATOMIC_RELAXED);
}
void getAtomically() {
  subject::atomicLoad(&shared[0], __ATOMIC_RELAXED);
}

TEST(Race, IsTwoUnorderedAccessesOfWhichOneWritesAndOneIsPlain) {
  const std::vector<std::pair<Body, Body>> races = {
      {put, put},           {put, get},           {get, put},
      {put, putAtomically}, {put, getAtomically}, {get, putAtomically},
      {putAtomically, put}, {putAtomically, get}, {getAtomically, put}};
  for (const auto &[first, second] : races) {
    EXPECT_DEATH(play({first, second}), AllOf(HasSubstr(race), HasSubstr("The earlier one: a "),
                                              HasSubstr("subject::shared+0x0 in")));
  }
  play({get, get});
  play({getAtomically, get});
  play({putAtomically, putAtomically, getAtomically});
  play({[] { put(), get(), put(); }});
  const auto putAndGet = [] {
    put();
    subject::atomicStore(&flag, 1, __ATOMIC_RELEASE);
    get(); /* does not hide the write from others */
  };
  EXPECT_DEATH(play({putAndGet, get}), race);
}

TEST(Race, IsFoundByTheByte) {
  auto *bytes = reinterpret_cast<uint8_t *>(shared);
  const auto writer = [=](size_t byte) { return [=] { subject::storeByte(bytes + byte, 1); }; };
  play({writer(3), writer(4), writer(8)});
  play({writer(3), [=] { subject::fill(bytes + 4, 20); }});
  play({[=] { subject::copy(bytes, bytes + 16, 3); }, writer(3)});
  EXPECT_DEATH(play({writer(23), [=] { subject::fill(bytes + 4, 20); }}), race);
  EXPECT_DEATH(play({writer(18), [=] { subject::copy(bytes, bytes + 16, 3); }}), race);
  EXPECT_DEATH(play({writer(2), [=] { subject::copy(bytes, bytes + 16, 3); }}), race);
  EXPECT_DEATH(play({writer(5), put}), race);
}

/* However many readers come behind the one that the writer knows nothing of. */
TEST(Race, WithAnyOfManyReadersIsFound) {
  const auto many = [](int unknown) {
    Machine machine;
    machine.watch();
    sim::HandOver done;
    for (int i = 0; i < 40; ++i) {
      machine.spawn("reader-" + std::to_string(i) + ";", [&done, i, unknown] {
        get();
        if (i != unknown) done.give();
      });
    }
    machine.spawn("writer", [&done] {
      done.take();
      put();
    });
    machine.run();
  };
  for (const int reader : {0, 17, 39}) {
    const std::string name = "reader-" + std::to_string(reader) + "; reads 8 bytes";
    EXPECT_DEATH(many(reader), AllOf(HasSubstr(race), HasSubstr(name)));
  }
  many(-1);
}

uint64_t *local; /* on the stack of a function that waits */

TEST(Race, OnAStackIsFound) {
  const auto owner = [] {
    subject::withLocal([](uint64_t *word) {
      subject::store(word, 1);
      local = word;
      zel_WorldSleep(10);
    });
  };
  EXPECT_DEATH(play({owner, [] { subject::store(local, 2); }}),
               AllOf(HasSubstr(race), HasSubstr("the stack of a, ")));
  /* The next fiber of the stack is another matter. */
  Machine machine;
  machine.watch();
  for (int i = 0; i < 3; ++i) {
    machine.spawn("owner", owner);
    machine.run();
  }
}

/* ---- What orders ----------------------------------------------------------------------------- */

TEST(Order, ComesFromALockFromAHandOverAndFromSpawning) {
  Bench bench;
  const zel_SpinlockHandle lock = bench.heap.lock("order", 1);
  const auto locked = [=](const Body &body) {
    return [=] {
      zel_SpinlockLock(lock);
      body();
      zel_SpinlockUnlock(lock);
    };
  };
  bench.machine.spawn("a", locked(put));
  bench.machine.spawn("b", locked(get));
  bench.machine.run();
  bench.machine.call("c", locked(put));
  bench.machine.call("d", get); /* c's end, the driver, d's beginning */

  sim::HandOver hand;
  bench.machine.spawn("giver", [&] {
    put();
    hand.give();
  });
  bench.machine.spawn("taker", [&] {
    hand.take();
    put();
  });
  bench.machine.run();
}

TEST(Order, DoesNotComeFromTheHostsOwnMutexes) {
  host::Mutex mutex;
  const auto locked = [&mutex](const Body &body) {
    return [&mutex, body] {
      const std::lock_guard guard(mutex);
      body();
    };
  };
  EXPECT_DEATH(play({locked(put), locked(get)}), race);
}

/* What two fibers see of a world: its creator and waker, and who ends it. */
void playWorld(bool wakes, bool readsBeforeTheEnd) {
  Bench bench;
  static zel_WorldID world;
  static bool stored;
  world = ZEL_NO_WORLD;
  stored = false;
  const auto body = [](void *) -> uint32_t {
    subject::load(&shared[1]); /* written by the creator */
    while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "work") == ZEL_OK) {
      if (stored) subject::load(&shared[2]); /* written by the waker */
      subject::store(&shared[3], 1);         /* read by who ends it */
    }
    return 0;
  };
  bench.machine.call("creator", [&] {
    subject::store(&shared[1], 1);
    EXPECT_EQ(TOLM_WorldCreate(&world, "world", 0, body, nullptr, 1, bench.heap.id), ZEL_OK);
  });
  bench.machine.run();
  bench.machine.spawn("waker", [&] {
    if (!wakes) zel_WorldForceWakeup(world);
    subject::store(&shared[2], 1);
    stored = true;
    if (wakes) zel_WorldForceWakeup(world);
  });
  bench.machine.run();
  bench.machine.call("end", [&] {
    if (readsBeforeTheEnd) subject::load(&shared[3]);
    TOLM_WorldDestroy(&world);
    subject::load(&shared[3]);
  });
}

TEST(Order, ComesFromAWorldsCreationItsWakeUpAndItsEnd) {
  playWorld(true, false);
  EXPECT_DEATH(playWorld(false, false), race);
  EXPECT_DEATH(playWorld(true, true), race);
}

/* A subscription whose calls, and whose last one, touch what others have written. */
struct Subscriber {
  KarstQuery query{};
  int calls = 0;
  bool before = false; /* a call reads what the canceller writes */

  Subscriber() {
    query.type = 20;
    query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL;
  }
  static zel_Status told(void *data, const KarstEntryHeader *, void *, zel_Status status) {
    auto *self = static_cast<Subscriber *>(data);
    subject::load(&shared[0]);                                      /* written by the subscriber */
    subject::store(&shared[1], static_cast<uint64_t>(self->calls)); /* and by each call */
    if (self->before || status == ZEL_SUB_CANCELLED) subject::load(&shared[2]);
    ++self->calls;
    return ZEL_OK;
  }
};

void playSubscription(uint64_t seed, bool before) {
  Simulation sim({.seed = seed, .switching = Switching::Random});
  sim.watch();
  Subscriber subscriber;
  sim.spawn("client", [&] {
    put();
    EXPECT_EQ(KARST_Subscribe(&subscriber.query, &Subscriber::told, &subscriber), ZEL_OK);
    for (uint8_t i = 0; i < 10; ++i) {
      sim.directory().put({20, {{i}}, {}, {0xa0}});
      zel_WorldSleep(1);
    }
    subscriber.before = before;
    sim.directory().put({20, {{20}}, {}, {0xa0}});
    subject::store(&shared[2], 1);
    KARST_Unsubscribe(&subscriber.query, &Subscriber::told, &subscriber);
  });
  sim.run();
  EXPECT_GE(subscriber.calls, 11);
}

TEST(Order, ComesFromASubscriptionItsCallsAndItsEnd) {
  for (uint64_t seed = 1; seed <= 20; ++seed) playSubscription(seed, false);
  const auto racy = [] {
    for (uint64_t seed = 1; seed <= 20; ++seed) playSubscription(seed, true);
  };
  EXPECT_DEATH(racy(), race);
}

void statusChanged(void *, uint32_t) {
  subject::load(&shared[0]);
  subject::store(&shared[1], 1);
}

void playStatus(bool readsBeforeTheEnd) {
  Simulation sim({.switching = Switching::Random});
  sim.watch();
  sim.spawn("client", [&] {
    put();
    EXPECT_EQ(KARST_RegisterStatusCallback(&statusChanged, nullptr), ZEL_OK);
    for (int i = 0; i < 8; ++i) {
      sim.directory().setUsable(i % 2 == 0);
      zel_WorldSleep(1);
    }
    if (readsBeforeTheEnd) subject::load(&shared[1]);
    KARST_DeregisterStatusCallback(&statusChanged, nullptr);
    subject::load(&shared[1]);
  });
  sim.run();
}

TEST(Order, ComesFromAStatusCallback) {
  playStatus(false);
  EXPECT_DEATH(playStatus(true), race);
}

/* ---- Atomics --------------------------------------------------------------------------------- */

Body publish(int order) {
  return [order] {
    put();
    subject::atomicStore(&flag, 1, order);
  };
}
Body observe(int order) {
  return [order] {
    subject::atomicLoad(&flag, order);
    get();
  };
}
Body add(int order) {
  return [order] { subject::atomicAdd(&flag, 1, order); };
}

TEST(Atomics, OrderByReleaseAndAcquire) {
  play({publish(__ATOMIC_RELEASE), observe(__ATOMIC_ACQUIRE)});
  play({publish(__ATOMIC_SEQ_CST), observe(__ATOMIC_SEQ_CST)});
  EXPECT_DEATH(play({publish(__ATOMIC_RELAXED), observe(__ATOMIC_ACQUIRE)}), race);
  EXPECT_DEATH(play({publish(__ATOMIC_RELEASE), observe(__ATOMIC_RELAXED)}), race);
}

TEST(Atomics, UpdatesContinueAReleaseSequenceAndStoresBreakIt) {
  const Body release = publish(__ATOMIC_RELEASE);
  const Body acquire = observe(__ATOMIC_ACQUIRE);
  const auto store = [] { subject::atomicStore(&flag, 5, __ATOMIC_RELAXED); };
  const auto exchange = [](uint64_t expected) {
    return [expected] { subject::atomicExchangeIf(&flag, expected, 7, __ATOMIC_RELAXED); };
  };
  play({release, add(__ATOMIC_RELAXED), exchange(2), acquire});
  play({release, exchange(0), acquire}); /* fails: a read */
  EXPECT_DEATH(play({release, store, acquire}), race);
  const auto another = [] { subject::atomicStore(&flag, 5, __ATOMIC_RELEASE); };
  EXPECT_DEATH(play({release, another, acquire}), race);
  EXPECT_DEATH(play({release, store, add(__ATOMIC_RELEASE), acquire}), race);
}

TEST(Atomics, ACountDownNeedsBothItsHalves) {
  const auto countDown = [](int order) {
    return [order] {
      subject::load(&shared[0]);
      if (subject::atomicAdd(&flag, 1, order) % 2 == 1) put(); /* the last one of two */
    };
  };
  play({countDown(__ATOMIC_ACQ_REL), countDown(__ATOMIC_ACQ_REL)});
  EXPECT_DEATH(play({countDown(__ATOMIC_RELEASE), countDown(__ATOMIC_RELEASE)}), race);
  EXPECT_DEATH(play({countDown(__ATOMIC_ACQUIRE), countDown(__ATOMIC_ACQUIRE)}), race);
}

TEST(Atomics, FencesOrderWhatIsRelaxed) {
  const auto put2 = [](int order) {
    return [order] {
      put();
      subject::fence(order);
      subject::atomicStore(&flag, 1, __ATOMIC_RELAXED);
    };
  };
  const auto get2 = [](int order) {
    return [order] {
      subject::atomicLoad(&flag, __ATOMIC_RELAXED);
      subject::fence(order);
      get();
    };
  };
  play({put2(__ATOMIC_RELEASE), get2(__ATOMIC_ACQUIRE)});
  EXPECT_DEATH(play({put2(__ATOMIC_ACQUIRE), get2(__ATOMIC_ACQUIRE)}), race);
  EXPECT_DEATH(play({put2(__ATOMIC_RELEASE), get2(__ATOMIC_RELEASE)}), race);
}

/* ---- Memory of the heap ---------------------------------------------------------------------- */

TEST(Memory, IsNotTouchedAfterItsEndNorBesideIt) {
  Bench bench;
  uint64_t *block = bench.heap.get(24);
  bench.machine.call("owner", [&] {
    subject::fill(block, 24);
    subject::storeByte(reinterpret_cast<uint8_t *>(block) + 23, 1);
  });
  const auto touching = [&](ptrdiff_t byte) {
    bench.machine.call("toucher",
                       [&] { subject::loadByte(reinterpret_cast<char *>(block) + byte); });
  };
  EXPECT_DEATH(touching(24), "memory is touched that nobody was given");
  EXPECT_DEATH(touching(-1), "memory is touched that nobody was given");
  EXPECT_DEATH(touching(1 << 20), "memory of the module heap that was never given");
  bench.machine.call("freer", [&] { bench.heap.put(block); });
  for (int i = 0; i < 100; ++i) bench.heap.put(bench.heap.get(24)); /* does not hide it */
  EXPECT_DEATH(
      bench.machine.call("toucher", [&] { subject::storeThrough(block, 1); }),
      AllOf(HasSubstr("memory is touched that was given back"), HasSubstr("toucher writes 8 bytes"),
            HasSubstr("subject::store(unsigned long*"),
            HasSubstr("subject::storeThrough(unsigned long*"),
            HasSubstr("byte 0 of a block of 24 bytes"), HasSubstr("driver allocated it"),
            HasSubstr("freer freed it")));
}

TEST(Memory, IsNotGivenBackWhileSomebodyMayTouchIt) {
  const auto playBoth = [](bool told) {
    Bench bench;
    uint64_t *block = bench.heap.get(64);
    sim::HandOver done;
    bench.machine.spawn("reader", [&] {
      subject::load(block + 3);
      done.give();
    });
    bench.machine.spawn("freer", [&] {
      if (told) done.take();
      bench.heap.put(block);
    });
    bench.machine.run();
  };
  playBoth(true);
  EXPECT_DEATH(playBoth(false), AllOf(HasSubstr(race), HasSubstr("freer gives it back")));
}

/* More than the arena holds passes through it; what is alive stays. */
TEST(Memory, IsUsedAgainWhenAllOfItHasBeenUsed) {
  Bench bench;
  uint64_t *kept = bench.heap.get(64);
  *kept = 12345;
  uint64_t *first = bench.heap.get(500000);
  bench.heap.put(first);
  bool again = false;
  for (size_t passed = 0; passed < 3 * sim::access::Arena::size; passed += 500000) {
    uint64_t *block = bench.heap.get(500000);
    ASSERT_NE(block, nullptr);
    again = again || block == first;
    bench.heap.put(block);
  }
  EXPECT_TRUE(again);
  EXPECT_EQ(*kept, 12345u);
  bench.heap.put(kept);
}

/* ---- Slots and guards ------------------------------------------------------------------------ */

struct Slot {
  char tag[8];
  uint64_t link;
  uint64_t value;
};
const sim::access::Slots slots{{offsetof(Slot, tag), 8}, "freefree", {{offsetof(Slot, link), 8}}};
const Structure slotStructure{
    .name = "Slot",
    .size = sizeof(Slot),
    .lock = "pool",
    .fields = {
        {0, 8, "tag", Guard::Lock}, {8, 8, "link", Guard::Lock}, {16, 8, "value", Guard::Lock}}};

TEST(Rules, KeepFreeSlotsUntouched) {
  Bench bench;
  auto *pool = reinterpret_cast<Slot *>(bench.heap.get(2 * sizeof(Slot)));
  std::memcpy(pool[0].tag, "freefree", 8);
  std::memcpy(pool[1].tag, "used    ", 8);
  bench.recorder.rules().pool(slotStructure, slots, pool, 2);
  const zel_SpinlockHandle lock = bench.heap.lock("pool", 1);
  const auto locked = [&](const Body &body) {
    bench.machine.call("user", [&] {
      zel_SpinlockLock(lock);
      body();
      zel_SpinlockUnlock(lock);
    });
  };
  locked([=] { subject::store(&pool[0].link, 1); });
  locked([=] { subject::store(&pool[1].value, 1); });
  EXPECT_DEATH(locked([=] { subject::load(&pool[0].value); }),
               "Slot number 0 is free: bytes 16 to 23 of it must not be touched");
  EXPECT_DEATH(locked([=] { subject::fill(&pool[0].tag, 23); }), "Slot number 0 is free");
  EXPECT_DEATH(locked([=] { subject::fill(&pool[0].value, 16); }), "reaches beyond one Slot");
  EXPECT_DEATH(bench.machine.call("user", [=] { subject::load(&pool[1].value); }),
               AllOf(HasSubstr("Slot.value needs the outer lock; the outer lock is \"pool\""),
                     HasSubstr("user reads 8 bytes"), HasSubstr("holding no lock")));
  locked([=] {
    subject::fill(&pool[0], sizeof(Slot));
    subject::store(&pool[0].value, 1);
  });
  bench.heap.put(pool);
}

struct Thing {
  zel_SpinlockHandle lock;
  uint64_t own, both, constant, atomic, free, looked, undeclared;
};
Structure thingStructure() {
  constexpr uint32_t word = sizeof(uint64_t);
  return {.name = "Thing",
          .size = sizeof(Thing),
          .lock = "outer",
          .ownLock = offsetof(Thing, lock),
          .fields = {{offsetof(Thing, lock), word, "lock", Guard::Constant},
                     {offsetof(Thing, own), word, "own", Guard::OwnLock},
                     {offsetof(Thing, both), word, "both", Guard::Both},
                     {offsetof(Thing, constant), word, "constant", Guard::Constant},
                     {offsetof(Thing, atomic), word, "atomic", Guard::Atomic},
                     {offsetof(Thing, free), word, "free", Guard::Free, "this test says so"},
                     {offsetof(Thing, looked), word, "looked", Guard::Lock, nullptr, "quick"}},
          .exempt = {{"subject::storeThrough", 2, "this test says so"}}};
}

TEST(Rules, AskForTheGuardOfAFieldOnceTheObjectIsShared) {
  Bench bench;
  bench.recorder.rules().blocks(thingStructure(), "subject::allocate");
  const zel_SpinlockHandle outer = bench.heap.lock("outer", 1);
  const zel_SpinlockHandle own = bench.heap.lock("own", 2);
  const zel_SpinlockHandle other = bench.heap.lock("own", 3);
  Thing *thing = nullptr;
  bench.machine.call("creator", [&] {
    thing = static_cast<Thing *>(subject::allocate(bench.heap.id, sizeof(Thing)));
    subject::fill(thing, sizeof *thing); /* still private */
    subject::store(&thing->lock, own);
    subject::store(&thing->undeclared, 1);
  });
  const auto with = [&](const std::vector<zel_SpinlockHandle> &locks, const Body &body) {
    bench.machine.call("user", [&] {
      for (const zel_SpinlockHandle lock : locks) zel_SpinlockLock(lock);
      body();
      for (const zel_SpinlockHandle lock : locks) zel_SpinlockUnlock(lock);
    });
  };
  const auto get = [&](uint64_t *field) { return [=] { subject::load(field); }; };
  const auto put = [&](uint64_t *field) { return [=] { subject::store(field, 1); }; };
  constexpr int relaxed = __ATOMIC_RELAXED;

  with({own}, put(&thing->own));
  EXPECT_DEATH(with({outer}, get(&thing->own)), "Thing.own needs its own lock");
  EXPECT_DEATH(with({other}, get(&thing->own)), "Thing.own needs its own lock");
  with({outer, own}, put(&thing->both));
  with({own}, get(&thing->both));
  with({outer}, get(&thing->both));
  EXPECT_DEATH(with({own}, put(&thing->both)), "Thing.both needs .* to be written");
  EXPECT_DEATH(with({}, get(&thing->both)), "Thing.both needs .* to be read");
  with({}, get(&thing->constant));
  EXPECT_DEATH(with({outer, own}, put(&thing->constant)), "Thing.constant is constant by now");
  with({}, [=] { subject::atomicAdd(&thing->atomic, 1, relaxed); });
  EXPECT_DEATH(with({outer, own}, get(&thing->atomic)), "Thing.atomic must be touched atomically");
  with({}, put(&thing->free));
  with({}, [=] { subject::atomicLoad(&thing->looked, relaxed); });
  EXPECT_DEATH(with({}, [=] { subject::atomicStore(&thing->looked, 1, relaxed); }), "Thing.looked");
  EXPECT_DEATH(with({}, get(&thing->looked)), "Thing.looked needs the outer lock");
  EXPECT_DEATH(with({outer}, put(&thing->looked)), "Thing.looked .* must be written atomically");
  EXPECT_DEATH(with({outer, own}, get(&thing->undeclared)), "belongs to no field");
  with({}, [=] { subject::storeThrough(&thing->own, 1); });

  bench.heap.put(thing);
}

TEST(Rules, AreNotTakenWithoutReasons) {
  Bench bench;
  Structure structure = thingStructure();
  structure.fields[5].reason = nullptr;
  EXPECT_DEATH(bench.recorder.rules().object(structure, shared),
               "Thing.free is guarded by nothing");
  structure = thingStructure();
  structure.exempt[0].reason = nullptr;
  EXPECT_DEATH(bench.recorder.rules().object(structure, shared), "exempt without a reason");
}

/* ---- The order of locks ---------------------------------------------------------------------- */

/* On a machine of its own: takes the locks one inside the other. */
void nest(const std::vector<const char *> &names) {
  Bench bench;
  std::vector<zel_SpinlockHandle> locks;
  for (const char *name : names) {
    locks.push_back(bench.heap.lock(name, static_cast<uint16_t>(locks.size() + 1)));
  }
  bench.machine.call("nester", [&] {
    for (const zel_SpinlockHandle lock : locks) zel_SpinlockLock(lock);
    for (const zel_SpinlockHandle lock : locks) zel_SpinlockUnlock(lock);
  });
}

TEST(LockOrder, ACircleOverSeveralRunsIsFound) {
  nest({"north", "east"});
  nest({"east", "south"});
  nest({"north", "south"});
  EXPECT_DEATH(nest({"south", "north"}), AllOf(HasSubstr("locks are taken in a circle"),
                                               HasSubstr("north inside \"south\", by nester"),
                                               HasSubstr("south inside \"north\", by nester")));
}

/* A client that calls back into what called it; a world that ends who waits for its end. */
TEST(LockOrder, CountsWhatElseIsWaitedFor) {
  const auto inCallback = [](bool ofAnother) {
    Bench bench;
    const zel_SpinlockHandle lock = bench.heap.lock("instance", 2);
    const zel_SpinlockHandle second = bench.heap.lock("instance", 3);
    bench.machine.call("caller", [&] {
      zel_SpinlockLock(lock);
      {
        const sim::Inside inside(bench.machine.scheduler().running(), sim::insideClientCallback);
        if (ofAnother) zel_SpinlockLock(second), zel_SpinlockUnlock(second);
      }
      zel_SpinlockUnlock(lock);
    });
  };
  inCallback(false);
  EXPECT_DEATH(inCallback(true), HasSubstr("instance inside \"instance\""));

  const auto stopping = [](bool crosswise) {
    Simulation sim;
    sim.watch();
    SimHeap heap;
    static zel_WorldID world;
    static bool deregisters;
    deregisters = crosswise;
    const KarstStatusFn status = [](void *, uint32_t usable) {
      if (!usable) TOLM_WorldDestroy(&world);
    };
    EXPECT_EQ(KARST_RegisterStatusCallback(status, nullptr), ZEL_OK);
    const auto body = [](void *data) -> uint32_t {
      if (deregisters) KARST_DeregisterStatusCallback(*static_cast<KarstStatusFn *>(data), nullptr);
      while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "work") == ZEL_OK) continue;
      return 0;
    };
    auto fn = status;
    EXPECT_EQ(TOLM_WorldCreate(&world, "worker", 0, body, &fn, 1, heap.id), ZEL_OK);
    sim.directory().setUsable(true);
    sim.run();
    sim.directory().setUsable(false);
    sim.run();
    if (deregisters) sim.call("end", [] { TOLM_WorldDestroy(&world); });
    sim.call("end", [&] { KARST_DeregisterStatusCallback(status, nullptr); });
  };
  stopping(false);
  EXPECT_DEATH(stopping(true),
               AllOf(HasSubstr("a status callback inside \"the body of world worker\""),
                     HasSubstr("the body of world worker inside \"a status callback")));
}

}  // namespace
