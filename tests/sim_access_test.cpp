/* The recorder of memory accesses: each thing that it must find is found in small instrumented code,
 * and what is right goes through.
 */
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <map>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

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
using subject::shared;
using testing::AllOf;
using testing::HasSubstr;

using Body = std::function<void()>;
using Report = testing::Matcher<const std::string &>;

constexpr const char *race = "a race: neither of two accesses happens before the other";

/* In a process of its own: must go through, or else end with such a report. */
void requireFine(const std::string &what, const Body &program) {
  EXPECT_EXIT((program(), std::_Exit(0)), testing::ExitedWithCode(0), "") << what;
}
void requireReport(const std::string &what, const Body &program, const Report &report) {
  EXPECT_DEATH(program(), report) << what;
}

/* A machine that is watched, with a heap. */
struct Bench {
  Machine machine;
  sim::access::Recorder &recorder = machine.watch();
  SimHeap heap;
};

/* ---- Races ----------------------------------------------------------------------------------- */

void put() {
  subject::store(&shared[0], 1);
}
void get() {
  subject::load(&shared[0]);
}

/* Plays "words of a fiber | words of the next" on fibers "f0", "f1", ... one behind the other, with
 * nothing between them that would make one happen before the next; `then` at the beginning: called
 * when those before have ended. */
class Play {
 public:
  explicit Play(const std::string &program) {
    subject::flag = 0;
    std::istringstream fibers(program);
    int number = 0;
    for (std::string fiber; std::getline(fibers, fiber, '|');) {
      const std::string name = "f" + std::to_string(number++);
      const auto body = [this, fiber] {
        std::istringstream words(fiber);
        for (std::string word; words >> word;) perform(word);
      };
      if (fiber.find("then") != std::string::npos) {
        bench_.machine.run();
        bench_.machine.call(name, body);
      } else {
        bench_.machine.spawn(name, body);
      }
    }
    bench_.machine.run();
  }

 private:
  /* `put` and `get` touch the first shared word, or the byte that is named; `fill` touches bytes 4
   * to 23, `copy` 16 to 18 and then 0 to 2; what has an order is about the flag. */
  void perform(const std::string &word) {
    const std::map<std::string, int> orders = {{"relaxed", __ATOMIC_RELAXED},
                                               {"acquire", __ATOMIC_ACQUIRE},
                                               {"release", __ATOMIC_RELEASE},
                                               {"both", __ATOMIC_ACQ_REL},
                                               {"strong", __ATOMIC_SEQ_CST}};
    const size_t colon = word.find(':');
    const std::string what = word.substr(0, colon);
    const std::string how = colon == std::string::npos ? "" : word.substr(colon + 1);
    const bool hasOrder = !how.empty() && how.find_first_of("0123456789") != 0;
    const int order = hasOrder ? orders.at(how) : __ATOMIC_RELAXED;
    uint64_t number = std::strtoul(how.c_str(), nullptr, 10);
    auto *bytes = reinterpret_cast<uint8_t *>(shared);
    if (what == "then") return;
    if (what == "put" && !how.empty()) return subject::storeByte(bytes + number, 1);
    if (what == "put") return put();
    if (what == "get") return get();
    if (what == "fill") return subject::fill(bytes + 4, 20);
    if (what == "copy") return subject::copy(bytes, bytes + 16, 3);
    if (what == "lock") return zel_SpinlockLock(lock_);
    if (what == "unlock") return zel_SpinlockUnlock(lock_);
    if (what == "mutex") return mutex_.lock();
    if (what == "no-mutex") return mutex_.unlock();
    if (what == "give") return hand_.give();
    if (what == "take") return hand_.take();
    if (what == "atomic-put") return __tsan_atomic64_store(&shared[0], 1, order);
    if (what == "atomic-get") return void(__tsan_atomic64_load(&shared[0], order));
    if (what == "plain-load") return void(subject::load(&subject::flag));
    if (what == "load") return void(__tsan_atomic64_load(&subject::flag, order));
    if (what == "store") return __tsan_atomic64_store(&subject::flag, 1, order);
    if (what == "fence") return __tsan_atomic_thread_fence(order);
    if (what == "exchange")
      return void(
          __tsan_atomic64_compare_exchange_strong(&subject::flag, &number, 7, order, order));
    if (what != "add" && what != "down") throw std::invalid_argument(word);
    if (what == "down") get(); /* one of two that read; the last one writes */
    const uint64_t before = __tsan_atomic64_fetch_add(&subject::flag, 1, order);
    if (what == "down" && before % 2 == 1) put();
  }

  Bench bench_;
  zel_SpinlockHandle lock_ = bench_.heap.lock("order", 1);
  host::Mutex mutex_;
  sim::HandOver hand_;
};

TEST(Race, IsTwoUnorderedAccessesOfWhichOneWritesAndOneIsPlain) {
  const char *const races[] = {
      "put | put", "put | get", "get | put", "put | atomic-put", "put | atomic-get",
      "get | atomic-put", "atomic-put | put", "atomic-put | get", "atomic-get | put",
      "put store:release get | get", /* the read hides no write */
      "put:23 | fill", "put:18 | copy", "put:2 | copy", "put:4 | put",
      "put store:relaxed | load:acquire get", "put store:release | load:relaxed get",
      /* a store ends a release sequence */
      "put store:release | store:relaxed | load:acquire get",
      "put store:release | store:release | load:acquire get",
      "put store:release | store:relaxed | add:release | load:acquire get",
      /* the host's own mutex orders nothing */
      "mutex put no-mutex | mutex get no-mutex", "down:release | down:release",
      "down:acquire | down:acquire",
      "put fence:acquire store:relaxed | load:relaxed fence:acquire get",
      "put fence:release store:relaxed | load:relaxed fence:release get"};
  const char *const fine[] = {
      "get | get", "atomic-get | get", "atomic-put | atomic-put | atomic-get", "put get put",
      "put:3 | put:4 | put:8", "put:3 | fill", "copy | put:3",
      "put store:release | load:acquire get", "put store:strong | load:strong get",
      /* updates continue it; an exchange that fails is a read */
      "put store:release | add:relaxed | exchange:2 | load:acquire get",
      "put store:release | add:release | load:acquire get",
      "put store:release | exchange:9 | load:acquire get", "exchange:9 | plain-load",
      "down:both | down:both", "lock put unlock | lock get unlock", "put give | take put",
      "then put | then get | get", /* a fiber's end, the driver, the next one's beginning */
      "put fence:release store:relaxed | load:relaxed fence:acquire get"};
  for (const std::string program : races)
    requireReport(
        program, [=] { Play play(program); }, HasSubstr(race));
  for (const std::string program : fine) requireFine(program, [=] { Play play(program); });
  EXPECT_DEATH(Play("put | get"),
               AllOf(HasSubstr("The earlier one: f0 writes 8 bytes"), HasSubstr("f1 reads 8 bytes"),
                     HasSubstr("subject::shared+0x0 in")));
}

/* However many readers come behind the one that the writer knows nothing of. */
TEST(Race, WithAnyOfManyReadersIsFound) {
  for (const int unknown : {0, 17, 39, 40}) {
    std::string program;
    for (int i = 0; i < 40; ++i) program += i == unknown ? "get | " : "get give | ";
    program += "take put";
    const Body body = [=] { Play play(program); };
    const std::string reader = "f" + std::to_string(unknown) + " reads 8 bytes";
    if (unknown == 40) {
      requireFine("all known", body);
    } else {
      requireReport(reader, body, AllOf(HasSubstr(race), HasSubstr(reader)));
    }
  }
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
  const Body two = [&] {
    Machine machine;
    machine.watch();
    machine.spawn("owner", owner);
    machine.spawn("other", [] { subject::store(local, 2); });
    machine.run();
  };
  requireReport("its owner waits", two, AllOf(HasSubstr(race), HasSubstr("the stack of owner, ")));
  requireFine("the stack's next fiber", [&] {
    Machine machine;
    machine.watch();
    for (int i = 0; i < 3; ++i) {
      machine.spawn("owner", owner);
      machine.run();
    }
  });
}

/* ---- What orders ----------------------------------------------------------------------------- */

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

TEST(Order, ComesFromWhatTheKernelPromisesAndFromNothingElse) {
  const auto subscription = [](bool before) {
    for (uint64_t seed = 1; seed <= 20; ++seed) playSubscription(seed, before);
  };
  requireFine("a world's creation, its wake-up, its end", [] { playWorld(true, false); });
  requireFine("a subscription, its calls, its end", [&] { subscription(false); });
  requireFine("a status callback, its end", [] { playStatus(false); });
  const Report isRace = HasSubstr(race);
  requireReport(
      "a wake-up before the work", [] { playWorld(false, false); }, isRace);
  requireReport(
      "before a world's end", [] { playWorld(true, true); }, isRace);
  requireReport(
      "before the last call", [&] { subscription(true); }, isRace);
  requireReport(
      "before the end of status calls", [] { playStatus(true); }, isRace);
}

/* ---- Memory of the heap ---------------------------------------------------------------------- */

TEST(Memory, IsNotTouchedAfterItsEndNorBesideIt) {
  Bench bench;
  uint64_t *block = bench.heap.get(24);
  bench.machine.call("owner", [&] {
    subject::fill(block, 24);
    subject::storeByte(reinterpret_cast<uint8_t *>(block) + 23, 1);
  });
  const auto touch = [&](ptrdiff_t byte) {
    return [&bench, byte, block] {
      bench.machine.call("toucher", [&] { subject::loadByte((char *)block + byte); });
    };
  };
  const std::string nobodys = "memory is touched that nobody was given";
  requireReport("behind it", touch(24), HasSubstr(nobodys));
  requireReport("in front of it", touch(-1), HasSubstr(nobodys));
  requireReport("far away", touch(1 << 20),
                HasSubstr("memory of the module heap that was never given"));
  bench.machine.call("freer", [&] { bench.heap.put(block); });
  for (int i = 0; i < 100; ++i) bench.heap.put(bench.heap.get(24)); /* does not hide it */
  requireReport(
      "after its end",
      [&] { bench.machine.call("toucher", [&] { subject::storeThrough(block, 1); }); },
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
  requireFine("told", [&] { playBoth(true); });
  requireReport(
      "not told", [&] { playBoth(false); },
      AllOf(HasSubstr(race), HasSubstr("freer gives it back")));
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

Body read(uint64_t *field) {
  return [=] { subject::load(field); };
}
Body write(uint64_t *field) {
  return [=] { subject::store(field, 1); };
}
Body filled(void *memory, size_t size) {
  return [=] { subject::fill(memory, size); };
}

/* By a fiber that holds these locks. */
struct Access {
  std::vector<zel_SpinlockHandle> locks;
  Body body;
  const char *report; /* null: it may */
};

void judge(Machine &machine, const std::vector<Access> &accesses) {
  for (size_t i = 0; i < accesses.size(); i++) {
    const auto &[locks, body, report] = accesses[i];
    const Body program = [&machine, &locks = locks, &body = body] {
      machine.call("user", [&] {
        for (const zel_SpinlockHandle lock : locks) zel_SpinlockLock(lock);
        body();
        for (const zel_SpinlockHandle lock : locks) zel_SpinlockUnlock(lock);
      });
    };
    const std::string name = "access " + std::to_string(i);
    if (report) {
      requireReport(name, program, testing::ContainsRegex(report));
    } else {
      program();
    }
  }
}

TEST(Rules, KeepFreeSlotsUntouched) {
  Bench bench;
  auto *pool = reinterpret_cast<Slot *>(bench.heap.get(2 * sizeof(Slot)));
  std::memcpy(pool[0].tag, "freefree", 8);
  std::memcpy(pool[1].tag, "used    ", 8);
  bench.recorder.rules().pool(slotStructure, slots, pool, 2);
  const zel_SpinlockHandle lock = bench.heap.lock("pool", 1);
  judge(
      bench.machine,
      {{{lock}, write(&pool[0].link), nullptr},
       {{lock}, write(&pool[1].value), nullptr},
       {{lock},
        read(&pool[0].value),
        "Slot number 0 is free: bytes 16 to 23 of it must not be touched"},
       {{lock}, filled(&pool[0].tag, 23), "Slot number 0 is free"},
       {{lock}, filled(&pool[0].value, 16), "reaches beyond one Slot"},
       {{},
        read(&pool[1].value),
        "Slot.value needs the outer lock; the outer lock is \"pool\"\nuser reads 8 bytes.*holding "
        "no lock"},
       {{lock}, filled(&pool[0], sizeof(Slot)), nullptr}, /* in use from here on, by one fiber */
       {{lock}, write(&pool[0].value), nullptr}});
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
  constexpr int relaxed = __ATOMIC_RELAXED;
  judge(bench.machine,
        {{{own}, write(&thing->own), nullptr},
         {{outer}, read(&thing->own), "Thing.own needs its own lock"},
         {{other}, read(&thing->own), "Thing.own needs its own lock"},
         {{outer, own}, write(&thing->both), nullptr},
         {{own}, read(&thing->both), nullptr},
         {{outer}, read(&thing->both), nullptr},
         {{own}, write(&thing->both), "Thing.both needs .* to be written"},
         {{}, read(&thing->both), "Thing.both needs .* to be read"},
         {{}, read(&thing->constant), nullptr},
         {{outer, own}, write(&thing->constant), "Thing.constant is constant by now"},
         {{}, [=] { __tsan_atomic64_store(&thing->atomic, 1, relaxed); }, nullptr},
         {{outer, own}, read(&thing->atomic), "Thing.atomic must be touched atomically"},
         {{}, write(&thing->free), nullptr},
         {{}, [=] { __tsan_atomic64_load(&thing->looked, relaxed); }, nullptr},
         {{}, [=] { __tsan_atomic64_store(&thing->looked, 1, relaxed); }, "Thing.looked"},
         {{}, read(&thing->looked), "Thing.looked needs the outer lock"},
         {{outer}, write(&thing->looked), "Thing.looked .* must be written atomically"},
         {{outer, own}, read(&thing->undeclared), "belongs to no field"},
         {{}, [=] { subject::storeThrough(&thing->own, 1); }, nullptr}});
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
