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
#include "tests/test_heap.h"

namespace {

using sim::access::Guard;
using sim::access::Structure;
using subject::shared;
using testing::AllOf;
using testing::HasSubstr;

using Body = std::function<void()>;
using Report = testing::Matcher<const std::string &>;

constexpr const char *race = "a race: neither of two accesses happens before the other";

/* A machine that is watched, with a heap. */
struct Bench {
  sim::Simulation machine;
  sim::access::Recorder &recorder = machine.watch();
  TestLocks heap;
};

/* ---- Programs -------------------------------------------------------------------------------- */

/* Plays "words of a fiber | words of the next" on fibers "f0", "f1", ... one behind the other, with
 * nothing between them that would make one happen before the next; `then` at the beginning: called
 * when all is quiet. `in-world`: what the world does when it is woken; `in-call`, `in-last`: a call
 * of the subscription, and its last one; `in-status`: a call of the status callback. */
class Play {
 public:
  explicit Play(const std::string &program) {
    subject::flag = 0;
    std::istringstream parts(program);
    int number = 0;
    for (std::string part; std::getline(parts, part, '|');) {
      std::istringstream words(part);
      std::string first;
      words >> first;
      if (first.starts_with("in-")) {
        std::getline(words, inside_[first]);
        continue;
      }
      const std::string name = "f" + std::to_string(number++);
      const Body body = [this, part] { act(part); };
      if (first == "then") {
        bench_.machine.run();
        bench_.machine.call(name, body);
      } else {
        bench_.machine.spawn(name, body);
      }
    }
    bench_.machine.run();
    if (!freed_) bench_.heap.put(block_);
  }

 private:
  void act(const std::string &words) {
    std::istringstream stream(words);
    for (std::string word; stream >> word;) {
      const size_t colon = word.find(':');
      perform(word.substr(0, colon), colon == std::string::npos ? "" : word.substr(colon + 1));
    }
  }

  /* `put` and `get` touch the first shared word, or the byte that is named; `fill` touches bytes 4
   * to 23, `copy` 16 to 18 and then 0 to 2; what has an order is about the flag; `touch` writes
   * a byte of a block of 64. */
  void perform(const std::string &what, const std::string &how) {
    const std::map<std::string, int> orders = {{"relaxed", __ATOMIC_RELAXED},
                                               {"acquire", __ATOMIC_ACQUIRE},
                                               {"release", __ATOMIC_RELEASE},
                                               {"both", __ATOMIC_ACQ_REL},
                                               {"strong", __ATOMIC_SEQ_CST}};
    const int order = orders.contains(how) ? orders.at(how) : __ATOMIC_RELAXED;
    const int64_t number = std::strtol(how.c_str(), nullptr, 10);
    auto *bytes = reinterpret_cast<uint8_t *>(shared);
    if (what == "then") return;
    if (what == "put" && !how.empty()) return subject::storeByte(bytes + number, 1);
    if (what == "put") return subject::store(&shared[0], 1);
    if (what == "get") return void(subject::load(&shared[0]));
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
    if (what == "exchange") return exchange(static_cast<uint64_t>(number));
    if (what == "add") return void(__tsan_atomic64_fetch_add(&subject::flag, 1, order));
    if (what == "down") return countDown(order);
    if (what == "touch") return subject::storeByte((char *)block_ + number, 1);
    if (what == "through") return subject::storeThrough(block_, 1);
    if (what == "free") return free();
    if (what == "world")
      return void(TOLM_WorldCreate(&world_, "w", 0, &world, this, 1, bench_.heap.id));
    if (what == "wake") return zel_WorldForceWakeup(world_);
    if (what == "end-world") return TOLM_WorldDestroy(&world_);
    if (what == "subscribe") return void(KARST_Subscribe(&query_, &called, this));
    if (what == "unsubscribe") return KARST_Unsubscribe(&query_, &called, this);
    if (what == "change")
      return bench_.machine.directory().put({query_.type, {{++changes_}}, {}, {0xa0}});
    if (what == "register") return void(KARST_RegisterStatusCallback(&status, this));
    if (what == "deregister") return KARST_DeregisterStatusCallback(&status, this);
    if (what == "usable") return bench_.machine.directory().setUsable(true);
    throw std::invalid_argument(what);
  }

  static void exchange(uint64_t expected) {
    constexpr int relaxed = __ATOMIC_RELAXED;
    __tsan_atomic64_compare_exchange_strong(&subject::flag, &expected, 7, relaxed, relaxed);
  }
  /* One of two that read; the last one writes. */
  static void countDown(int order) {
    subject::load(&shared[0]);
    if (__tsan_atomic64_fetch_add(&subject::flag, 1, order) == 1) subject::store(&shared[0], 1);
  }
  void free() {
    freed_ = true;
    bench_.heap.put(block_);
    for (int i = 0; i < 100; ++i) bench_.heap.put(bench_.heap.get(64)); /* does not hide it */
  }

  static uint32_t world(void *data) {
    auto *play = static_cast<Play *>(data);
    while (zel_WorldWait(0, ZEL_NO_SPINLOCK, ZEL_TIMEOUT_NONE, "work") == ZEL_OK)
      play->act(play->inside_["in-world"]);
    return 0;
  }
  static zel_Status called(void *data, const KarstEntryHeader *, void *, zel_Status status) {
    auto *play = static_cast<Play *>(data);
    play->act(play->inside_[status == ZEL_SUB_CANCELLED ? "in-last" : "in-call"]);
    return ZEL_OK;
  }
  static void status(void *data, uint32_t) {
    auto *play = static_cast<Play *>(data);
    play->act(play->inside_["in-status"]);
  }

  Bench bench_;
  zel_SpinlockHandle lock_ = bench_.heap.keep("order", 1);
  host::Mutex mutex_;
  sim::HandOver hand_;
  uint64_t *block_ = bench_.heap.get(64);
  bool freed_ = false;
  zel_WorldID world_ = ZEL_NO_WORLD;
  KarstQuery query_{{}, {}, 0, 20, KARST_QUERY_BY_TYPE | KARST_QUERY_ALL, {}};
  uint8_t changes_ = 0;
  std::map<std::string, std::string> inside_;
};

/* Each in a process of its own. */
void requireFine(const std::vector<std::string> &programs) {
  for (const std::string &program : programs) {
    const auto play = [&] {
      { const Play whole(program); }
      std::_Exit(0);
    };
    EXPECT_EXIT(play(), testing::ExitedWithCode(0), "") << program;
  }
}
void requireReport(const std::vector<std::string> &programs, const Report &report) {
  for (const std::string &program : programs) EXPECT_DEATH(Play{program}, report) << program;
}

TEST(Race, IsTwoUnorderedAccessesOfWhichOneWritesAndOneIsPlain) {
  requireReport({"put | put", "put | get", "get | put", "put | atomic-put", "put | atomic-get",
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
                 "put fence:release store:relaxed | load:relaxed fence:release get"},
                HasSubstr(race));
  requireFine(
      {"get | get", "atomic-get | get", "atomic-put | atomic-put | atomic-get", "put get put",
       "put:3 | put:4 | put:8", "put:3 | fill", "copy | put:3",
       "put store:release | load:acquire get", "put store:strong | load:strong get",
       /* updates continue it; an exchange that fails is a read */
       "put store:release | add:relaxed | exchange:2 | load:acquire get",
       "put store:release | add:release | load:acquire get",
       "put store:release | exchange:9 | load:acquire get", "exchange:9 | plain-load",
       "down:both | down:both", "lock put unlock | lock get unlock", "put give | take put",
       "then put | then get | get", /* a fiber's end, the driver, the next one's beginning */
       "put fence:release store:relaxed | load:relaxed fence:acquire get"});
  requireReport({"put | get"},
                AllOf(HasSubstr("The earlier one: f0 writes 8 bytes"),
                      HasSubstr("f1 reads 8 bytes"), HasSubstr("subject::shared+0x0 in")));
}

/* However many readers come behind the one that the writer knows nothing of. */
TEST(Race, WithAnyOfManyReadersIsFound) {
  for (const int unknown : {0, 17, 39}) {
    std::string program;
    for (int i = 0; i < 40; ++i) program += i == unknown ? "get | " : "get give | ";
    const std::string reader = "f" + std::to_string(unknown) + " reads 8 bytes";
    requireReport({program + "take put"}, AllOf(HasSubstr(race), HasSubstr(reader)));
  }
}

TEST(Order, ComesFromWhatTheKernelPromisesAndFromNothingElse) {
  requireFine({"in-world get | put world | then wake | then end-world",
               "in-world get | world | then put wake | then end-world",
               "in-world put | world | then wake | then end-world get",
               "in-call get put:8 | put subscribe | then change | then change | then unsubscribe",
               "in-last get | subscribe | then put unsubscribe",
               "in-status get put:8 | put register | then usable | then deregister get:8"});
  requireReport(
      {"in-world get | world | then wake put | then end-world",
       "in-world put | world | then wake | then get", "in-call get | subscribe put | then change",
       "in-last get | subscribe | then unsubscribe put",
       "in-status put | register | then usable | then get"},
      HasSubstr(race));
}

TEST(Memory, IsNotTouchedAfterItsEndNorBesideIt) {
  requireFine({"touch:0 touch:63 free", "touch:24 give | take free"});
  requireReport({"touch:64", "touch:-1"}, HasSubstr("memory is touched that nobody was given"));
  requireReport({"touch:1048576"}, HasSubstr("memory of the module heap that was never given"));
  requireReport({"touch:24 | free"}, AllOf(HasSubstr(race), HasSubstr("f1 gives it back")));
  requireReport({"free | through"},
                AllOf(HasSubstr("memory is touched that was given back"),
                      HasSubstr("f1 writes 8 bytes"), HasSubstr("subject::store(unsigned long*"),
                      HasSubstr("subject::storeThrough(unsigned long*"),
                      HasSubstr("byte 0 of a block of 64 bytes"), HasSubstr("driver allocated it"),
                      HasSubstr("f0 freed it")));
}

/* More than the arena holds passes through it; what is alive stays. */
TEST(Memory, IsUsedAgainWhenAllOfItHasBeenUsed) {
  Bench bench;
  uint64_t *kept = bench.heap.get(64);
  *kept = 12345;
  for (size_t passed = 0; passed < 3 * sim::access::Arena::size; passed += 500000) {
    uint64_t *block = bench.heap.get(500000);
    ASSERT_NE(block, nullptr);
    std::memset(block, 0, 500000);
    bench.heap.put(block);
  }
  EXPECT_EQ(*kept, 12345u);
  bench.heap.put(kept);
}

/* ---- Slots and guards ------------------------------------------------------------------------ */

struct Slot {
  char tag[8];
  uint64_t link;
  uint64_t value;
};

Body read(uint64_t *field) {
  return [=] { subject::load(field); };
}
Body write(uint64_t *field) {
  return [=] { subject::store(field, 1); };
}
Body filled(void *memory, size_t size) {
  return [=] { subject::fill(memory, size); };
}

/* By a fiber that holds these locks. That what is right goes through shows in every search: it
 * watches the module with guards of each kind. */
struct Access {
  std::vector<zel_SpinlockHandle> locks;
  Body body;
  const char *report;
};

void requireReports(sim::Machine &machine, const std::vector<Access> &accesses) {
  for (const Access &access : accesses) {
    const Body program = [&] {
      for (const zel_SpinlockHandle lock : access.locks) zel_SpinlockLock(lock);
      access.body();
    };
    EXPECT_DEATH(machine.call("user", program), testing::ContainsRegex(access.report));
  }
}

TEST(Rules, KeepFreeSlotsUntouched) {
  Bench bench;
  auto *pool = reinterpret_cast<Slot *>(bench.heap.get(2 * sizeof(Slot)));
  std::memcpy(pool[0].tag, "freefree", 8);
  std::memcpy(pool[1].tag, "used    ", 8);
  bench.recorder.rules().pool(
      {.name = "Slot",
       .size = sizeof(Slot),
       .lock = "pool",
       .fields = {{8, 8, "link", Guard::Lock}, {16, 8, "value", Guard::Lock}}},
      {{offsetof(Slot, tag), 8}, "freefree", {{offsetof(Slot, link), 8}}}, pool, 2);
  const zel_SpinlockHandle lock = bench.heap.keep("pool", 1);
  requireReports(
      bench.machine,
      {{{lock},
        read(&pool[0].value),
        "Slot number 0 is free: bytes 16 to 23 of it must not be touched"},
       {{lock}, filled(&pool[0].tag, 23), "Slot number 0 is free"},
       {{lock}, filled(&pool[0].value, 16), "reaches beyond one Slot"},
       {{},
        read(&pool[1].value),
        "Slot.value needs the outer lock; the outer lock is \"pool\"\nuser reads 8 bytes.*holding "
        "no lock"}});
  bench.heap.put(pool);
}

struct Thing {
  zel_SpinlockHandle lock;
  uint64_t own, both, constant, atomic, looked, undeclared;
};
const Structure thingStructure{
    .name = "Thing",
    .size = sizeof(Thing),
    .lock = "outer",
    .ownLock = offsetof(Thing, lock),
    .fields = {{offsetof(Thing, own), 8, "own", Guard::OwnLock},
               {offsetof(Thing, both), 8, "both", Guard::Both},
               {offsetof(Thing, constant), 8, "constant", Guard::Constant},
               {offsetof(Thing, atomic), 8, "atomic", Guard::Atomic},
               {offsetof(Thing, looked), 8, "looked", Guard::Lock, nullptr, "quick"}},
    .exempt = {{"subject::storeThrough", 2, "called by none of those below"}}};

TEST(Rules, AskForTheGuardOfAFieldOnceTheObjectIsShared) {
  Bench bench;
  bench.recorder.rules().blocks(thingStructure, "subject::allocate");
  const zel_SpinlockHandle outer = bench.heap.keep("outer", 1);
  const zel_SpinlockHandle own = bench.heap.keep("own", 2);
  const zel_SpinlockHandle other = bench.heap.keep("own", 3);
  Thing *thing = nullptr;
  bench.machine.call("creator", [&] {
    thing = static_cast<Thing *>(subject::allocate(bench.heap.id, sizeof(Thing)));
    subject::fill(thing, sizeof *thing); /* still private */
    subject::store(&thing->lock, own);
  });
  requireReports(
      bench.machine,
      {{{outer}, read(&thing->own), "Thing.own needs its own lock"},
       {{other}, read(&thing->own), "Thing.own needs its own lock"},
       {{own}, write(&thing->both), "Thing.both needs .* to be written"},
       {{}, read(&thing->both), "Thing.both needs .* to be read"},
       {{outer, own}, write(&thing->constant), "Thing.constant is constant by now"},
       {{outer, own}, read(&thing->atomic), "Thing.atomic must be touched atomically"},
       {{}, [=] { __tsan_atomic64_store(&thing->looked, 1, __ATOMIC_RELAXED); }, "Thing.looked"},
       {{}, read(&thing->looked), "Thing.looked needs the outer lock"},
       {{outer}, write(&thing->looked), "Thing.looked .* must be written atomically"},
       {{outer, own}, read(&thing->undeclared), "belongs to no field"}});
  bench.heap.put(thing);
}

/* ---- The order of locks ---------------------------------------------------------------------- */

/* On a machine of its own: takes the locks one inside the other. */
void nest(const std::vector<const char *> &names) {
  Bench bench;
  std::vector<zel_SpinlockHandle> locks;
  for (const char *name : names)
    locks.push_back(bench.heap.keep(name, static_cast<uint16_t>(locks.size() + 1)));
  bench.machine.call("nester", [&] {
    for (const zel_SpinlockHandle lock : locks) zel_SpinlockLock(lock);
    for (const zel_SpinlockHandle lock : locks) zel_SpinlockUnlock(lock);
  });
}

TEST(LockOrder, ACircleOverSeveralRunsIsFound) {
  nest({"north", "east"});
  nest({"east", "south"});
  EXPECT_DEATH(nest({"south", "north"}), AllOf(HasSubstr("locks are taken in a circle"),
                                               HasSubstr("north inside \"south\", by nester"),
                                               HasSubstr("east inside \"north\", by nester"),
                                               HasSubstr("south inside \"east\", by nester")));
}

/* A status callback that ends a world, and a world that waits for the end of status callbacks. */
TEST(LockOrder, CountsWhatElseIsWaitedFor) {
  Play("in-status end-world | world register | then usable | then deregister");
  requireReport({"in-world deregister | world register | then wake | then end-world"},
                AllOf(HasSubstr("a status callback inside \"the body of world w\""),
                      HasSubstr("the body of world w inside \"a status callback")));
}

}  // namespace
