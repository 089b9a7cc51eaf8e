/* The directory's promises: lookups and walks, what a subscription is told and in which order,
 * overflow, cancellation, status callbacks, the end. Callbacks that must be caught in the middle
 * stop at a gate; everything else waits for the directory to be idle.
 */
#include "host/directory/directory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <latch>
#include <map>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

#include "host/kernel/log.h"

namespace {

using host::Directory;
using host::DirectorySettings;
using host::Entry;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr uint8_t node = KARST_TYPE_NODE;
constexpr uint8_t object = 40;

/* UUIDs of the tests are told apart, and ordered, by their first byte. */
zel_UUID uuid(uint8_t number) {
  return {{number}};
}

Entry entry(uint8_t type, uint8_t number, uint8_t owner = 1, size_t dataLength = 0) {
  return {type, uuid(number), uuid(owner), std::vector<uint8_t>(dataLength, number)};
}

KarstQuery every(uint8_t type) {
  KarstQuery query{};
  query.type = type;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL | KARST_QUERY_REPLICA;
  return query;
}

KarstQuery one(uint8_t type, uint8_t number) {
  KarstQuery query{};
  query.type = type;
  query.uuid = uuid(number);
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_REPLICA;
  return query;
}

/* Holds a callback until the test lets it go on. */
class Gate {
 public:
  void pass() { /* in the callback */
    reached_.count_down();
    opened_.wait();
  }
  void awaitCaller() { reached_.wait(); }
  void open() { opened_.count_down(); }

 private:
  std::latch reached_{1}, opened_{1};
};

struct Event {
  zel_Status status;
  uint8_t number; /* of the entry's UUID */
  uint8_t owner;
  size_t dataLength = 0;
  bool operator==(const Event &) const = default;
};

void PrintTo(const Event &event, std::ostream *out) {
  *out << std::hex << event.status << " " << int{event.number} << " of " << int{event.owner};
}

Event ok(uint8_t number, uint8_t owner = 1) {
  return {ZEL_OK, number, owner};
}
Event gone(uint8_t number, uint8_t owner = 1) {
  return {ZEL_NOT_FOUND, number, owner};
}
constexpr Event cancelled{ZEL_SUB_CANCELLED, 0, 0};
constexpr Event overflow{ZEL_SUB_OVERFLOW, 0, 0};
constexpr Event resync{ZEL_SUB_RESYNC, 0, 0};

/* A subscriber that keeps what it is told. */
class Subscriber {
 public:
  Subscriber(Directory &directory, const KarstQuery &query)
      : directory_(directory), query_(query) {}

  zel_Status subscribe() { return directory_.subscribe(&query_, called, this); }
  void unsubscribe() { directory_.unsubscribe(&query_, called, this); }

  std::vector<Event> events() const {
    const std::lock_guard lock(mutex_);
    return events_;
  }

  /* Called in the callback, after the event has been kept. Set before subscribing. */
  std::function<void(const Event &, const KarstEntryHeader &)> act;

 private:
  static zel_Status called(void *data, const KarstEntryHeader *header, void *, zel_Status status) {
    Subscriber &self = *static_cast<Subscriber *>(data);
    EXPECT_FALSE(self.inside_.exchange(true)) << "calls of one subscription overlap";
    const Event event{status, header->uuid.bytes[0], header->owner.bytes[0], header->dataLength};
    {
      const std::lock_guard lock(self.mutex_);
      self.events_.push_back(event);
    }
    if (self.act) self.act(event, *header);
    self.inside_ = false;
    return ZEL_OK;
  }

  Directory &directory_;
  const KarstQuery query_;
  mutable std::mutex mutex_;
  std::vector<Event> events_;
  std::atomic<bool> inside_{false};
};

/* An allocator as modules have, which counts what is alive and can fail. */
struct Allocator {
  Allocator() : table{allocate, allocateZeroed, release, this} {}
  ExprMshAllocator table;
  int alive = 0;
  bool failing = false;
  std::function<void()> onAllocate;

  static void *allocate(void *context, uint64_t size) {
    Allocator &self = *static_cast<Allocator *>(context);
    if (self.onAllocate) self.onAllocate();
    if (self.failing) return nullptr;
    ++self.alive;
    return std::malloc(size);
  }
  static void *allocateZeroed(void *context, uint64_t size) {
    void *block = allocate(context, size);
    return block != nullptr ? std::memset(block, 0, size) : nullptr;
  }
  static void release(void *context, void *block) {
    if (block != nullptr) --static_cast<Allocator *>(context)->alive;
    std::free(block);
  }
};

std::vector<uint8_t> walk(const Directory &directory, const KarstQuery &query,
                          const std::function<void(uint8_t)> &between = {}) {
  std::vector<uint8_t> numbers;
  KarstEntryHeader header{};
  for (uint32_t next = 0; directory.findEntry(query, next, &header) == ZEL_OK; next = 1) {
    numbers.push_back(header.uuid.bytes[0]);
    if (between) between(numbers.back());
  }
  return numbers;
}

/* ---- Lookups --------------------------------------------------------------------------------- */

TEST(DirectoryLookup, WalksOneTypeInOrderOfUuid) {
  Directory directory;
  for (uint8_t number : {7, 3, 200, 5}) directory.put(entry(node, number));
  directory.put(entry(node - 1, 4));
  directory.put(entry(node + 1, 1));
  EXPECT_THAT(walk(directory, every(node)), ElementsAre(3, 5, 7, 200));
  EXPECT_THAT(walk(directory, one(node, 5)), ElementsAre(5));
  EXPECT_THAT(walk(directory, one(node, 4)), IsEmpty());
  EXPECT_THAT(walk(directory, every(object)), IsEmpty());
}

TEST(DirectoryLookup, WalkSurvivesChangesMadeMeanwhile) {
  Directory directory;
  for (uint8_t number : {10, 20, 30, 40}) directory.put(entry(node, number));
  const auto change = [&](uint8_t number) {
    if (number == 10) directory.put(entry(node, 5)); /* behind: not seen */
    if (number == 20) {
      directory.remove(node, uuid(20)); /* the very place */
      directory.remove(node, uuid(30)); /* the next one */
      directory.put(entry(node, 25));
    }
    if (number == 40) directory.remove(node, uuid(40));
  };
  EXPECT_THAT(walk(directory, every(node), change), ElementsAre(10, 20, 25, 40));
}

TEST(DirectoryLookup, HeaderCarriesOwnerAndLength) {
  Directory directory;
  directory.put(entry(object, 9, 4, 300));
  KarstEntryHeader header{};
  ASSERT_EQ(directory.findEntry(one(object, 9), 0, &header), ZEL_OK);
  EXPECT_EQ(header.uuid, uuid(9));
  EXPECT_EQ(header.owner, uuid(4));
  EXPECT_EQ(header.dataLength, 300u);
}

TEST(DirectoryLookup, BadQueriesAndPlacesAreRefused) {
  Directory directory;
  directory.put(entry(node, 1));
  KarstQuery untyped = every(node);
  untyped.flags = KARST_QUERY_ALL;
  KarstEntryHeader header{};
  Allocator allocator;
  KarstFullEntry *whole = nullptr;
  EXPECT_EQ(directory.findEntry(untyped, 0, &header), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findEntry(every(node), 2, &header), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findEntry(every(node), 1, &header), ZEL_BAD_PARAM) << "a header never filled";
  EXPECT_EQ(directory.findFullEntry(untyped, allocator.table, &whole), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findFullEntry(header, allocator.table, &whole), ZEL_BAD_PARAM);
  ASSERT_EQ(directory.findEntry(every(node), 0, &header), ZEL_OK);
  EXPECT_EQ(directory.findEntry(every(object), 1, &header), ZEL_BAD_PARAM) << "of another walk";
  EXPECT_EQ(directory.subscribe(&untyped, nullptr, nullptr), ZEL_BAD_PARAM);
  Subscriber subscriber(directory, untyped);
  EXPECT_EQ(subscriber.subscribe(), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.subscriptions(), 0u);
  EXPECT_EQ(allocator.alive, 0);
}

TEST(DirectoryLookup, WholeEntryIsOneBlockOfTheCallersAllocator) {
  Directory directory;
  directory.put(entry(node, 7, 2, 5));
  Allocator allocator;
  /* The allocator is a module's: it may look something up itself. */
  allocator.onAllocate = [&] { EXPECT_TRUE(directory.entry(node, uuid(7)).has_value()); };
  KarstFullEntry *whole = nullptr;
  ASSERT_EQ(directory.findFullEntry(one(node, 7), allocator.table, &whole), ZEL_OK);
  EXPECT_EQ(allocator.alive, 1);
  EXPECT_EQ(whole->header.owner, uuid(2));
  ASSERT_EQ(whole->header.dataLength, 5u);
  EXPECT_EQ(std::memcmp(whole + 1, "\7\7\7\7\7", 5), 0);
  allocator.table.free(allocator.table.context, whole);

  whole = nullptr;
  allocator.failing = true;
  EXPECT_EQ(directory.findFullEntry(one(node, 7), allocator.table, &whole), ZEL_NO_MEMORY);
  allocator.failing = false;
  EXPECT_EQ(directory.findFullEntry(one(node, 8), allocator.table, &whole), ZEL_NOT_FOUND);
  EXPECT_EQ(whole, nullptr);
  EXPECT_EQ(allocator.alive, 0);
}

TEST(DirectoryLookup, WholeEntryByHeaderIsThePresentOne) {
  Directory directory;
  directory.put(entry(node, 7, 2, 5));
  directory.put(entry(object, 7, 9, 1)); /* the same UUID, another type */
  KarstEntryHeader header{};
  ASSERT_EQ(directory.findEntry(every(node), 0, &header), ZEL_OK);
  directory.put(entry(node, 7, 3, 8));
  Allocator allocator;
  KarstFullEntry *whole = nullptr;
  ASSERT_EQ(directory.findFullEntry(header, allocator.table, &whole), ZEL_OK);
  EXPECT_EQ(whole->header.owner, uuid(3));
  EXPECT_EQ(whole->header.dataLength, 8u);
  allocator.table.free(allocator.table.context, whole);
  directory.remove(node, uuid(7));
  EXPECT_EQ(directory.findFullEntry(header, allocator.table, &whole), ZEL_NOT_FOUND);
}

TEST(DirectoryLookup, GoesOnWhileACallbackDoesNotReturn) {
  Directory directory({1, 4});
  Gate gate;
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) gate.pass();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(node, 1));
  gate.awaitCaller();
  /* The only delivery thread is busy and the queue is filled beyond its bound. */
  for (uint8_t number = 2; number < 20; ++number) directory.put(entry(node, number));
  EXPECT_EQ(walk(directory, every(node)).size(), 19u);
  EXPECT_EQ(directory.entries(node).size(), 19u);
  EXPECT_EQ(directory.activity(), 1u);
  gate.open();
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

/* ---- What subscribers are told --------------------------------------------------------------- */

TEST(DirectoryDelivery, WhatIsThereThenEveryChangeInOrder) {
  Directory directory;
  for (uint8_t number : {30, 10, 20}) directory.put(entry(node, number));
  directory.put(entry(object, 15));
  Gate gate;
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event.number == 10) gate.pass();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  gate.awaitCaller();
  /* While the first is still being told. */
  directory.put(entry(node, 5));
  directory.put(entry(node, 5)); /* equal: nobody is told */
  directory.remove(node, uuid(20));
  directory.remove(node, uuid(21)); /* unknown */
  directory.put(entry(object, 16));
  directory.put(entry(node, 20));
  gate.open();
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(10), ok(20), ok(30), ok(5), gone(20), ok(20)));
  EXPECT_EQ(directory.activity(), 6u);
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryDelivery, OneEntrysSubscriptionHearsOfNoOther) {
  Directory directory;
  directory.put(entry(object, 1));
  Subscriber subscriber(directory, one(object, 2));
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(object, 2));
  directory.put(entry(object, 3));
  directory.put(entry(node, 2));
  directory.remove(object, uuid(2));
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(2), gone(2)));
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryDelivery, NewOwnerIsToldAfterTheOldPairingIsGone) {
  Directory directory;
  directory.put(entry(object, 7, 1));
  Subscriber subscriber(directory, one(object, 7));
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(object, 7, 2));
  directory.remove(object, uuid(7));
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(7, 1), gone(7, 1), ok(7, 2), gone(7, 2)));
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryDelivery, IsNeverMadeByTheThreadThatSubscribesOrChanges) {
  Directory directory;
  directory.put(entry(node, 1));
  const auto here = std::this_thread::get_id();
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &, const KarstEntryHeader &) {
    EXPECT_NE(std::this_thread::get_id(), here);
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(node, 2));
  directory.waitUntilIdle();
  subscriber.unsubscribe();
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(1), ok(2), cancelled));
}

TEST(DirectoryDelivery, TakesTurnsBetweenSubscriptions) {
  Directory directory({1, 16});
  Gate gate;
  Subscriber holder(directory, one(object, 1));
  holder.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) gate.pass();
  };
  ASSERT_EQ(holder.subscribe(), ZEL_OK);
  directory.put(entry(object, 1));
  gate.awaitCaller();
  std::vector<int> turns; /* one delivery thread: no lock needed */
  Subscriber first(directory, every(node)), second(directory, every(node));
  first.act = [&](const Event &, const KarstEntryHeader &) { turns.push_back(1); };
  second.act = [&](const Event &, const KarstEntryHeader &) { turns.push_back(2); };
  for (uint8_t number : {1, 2, 3}) directory.put(entry(node, number));
  ASSERT_EQ(first.subscribe(), ZEL_OK);
  ASSERT_EQ(second.subscribe(), ZEL_OK);
  gate.open();
  directory.waitUntilIdle();
  EXPECT_THAT(turns, ElementsAre(1, 2, 1, 2, 1, 2));
  for (Subscriber *subscriber : {&holder, &first, &second}) subscriber->unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryDelivery, HeaderOfAnEventNamesItsEntry) {
  Directory directory;
  Allocator allocator;
  Subscriber subscriber(directory, every(object));
  zel_Status found = ZEL_FAILURE;
  subscriber.act = [&](const Event &event, const KarstEntryHeader &header) {
    if (event.status != ZEL_OK) return;
    KarstFullEntry *whole = nullptr;
    found = directory.findFullEntry(header, allocator.table, &whole);
    allocator.table.free(allocator.table.context, whole);
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(object, 3));
  directory.waitUntilIdle();
  EXPECT_EQ(found, ZEL_OK);
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryDelivery, CallbacksMaySubscribeAndUnsubscribe) {
  for (const unsigned threads : {1u, 2u}) {
    Directory directory({threads, 16});
    directory.put(entry(node, 1));
    directory.put(entry(object, 2));
    Subscriber inner(directory, every(object)), outer(directory, every(node));
    outer.act = [&](const Event &event, const KarstEntryHeader &) {
      if (event == ok(1)) {
        EXPECT_EQ(inner.subscribe(), ZEL_OK);
      } else if (event == gone(1)) {
        inner.unsubscribe();
        outer.unsubscribe(); /* from inside its own callback */
        EXPECT_EQ(outer.events().back(), gone(1)) << "the last call comes after this one";
      }
    };
    ASSERT_EQ(outer.subscribe(), ZEL_OK);
    directory.waitUntilIdle();
    directory.remove(node, uuid(1));
    directory.waitUntilIdle();
    EXPECT_THAT(outer.events(), ElementsAre(ok(1), gone(1), cancelled));
    EXPECT_THAT(inner.events(), ElementsAre(ok(2), cancelled));
    EXPECT_EQ(directory.subscriptions(), 0u);
  }
}

/* ---- Overflow and resynchronisation ---------------------------------------------------------- */

TEST(DirectoryOverflow, IsToldOnceAndDeliveryGoesOn) {
  Directory directory({2, 3});
  Gate first, rescan;
  Subscriber subscriber(directory, every(node));
  std::vector<uint8_t> seenByRescan;
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) first.pass();
    if (event == overflow) {
      rescan.pass();
      seenByRescan = walk(directory, every(node));
    }
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(node, 1));
  first.awaitCaller();
  for (uint8_t number = 2; number <= 9; ++number) directory.put(entry(node, number));
  EXPECT_EQ(directory.overflows(), 1u);
  first.open();
  rescan.awaitCaller();
  directory.put(entry(node, 10)); /* the overflow's call has begun: queued again */
  rescan.open();
  directory.waitUntilIdle();
  directory.put(entry(node, 11));
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(),
              ElementsAre(ok(1), ok(2), ok(3), ok(4), overflow, ok(10), ok(11)));
  EXPECT_THAT(seenByRescan, ElementsAre(1, 2, 3, 4, 5, 6, 7, 8, 9, 10));
  EXPECT_EQ(directory.overflows(), 1u);
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryOverflow, WhatIsThereAtTheStartDoesNotCount) {
  Directory directory({1, 2});
  for (uint8_t number = 1; number <= 20; ++number) directory.put(entry(node, number));
  Gate gate;
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) gate.pass();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  gate.awaitCaller();
  directory.put(entry(node, 30));
  directory.put(entry(node, 31));
  EXPECT_EQ(directory.overflows(), 0u);
  directory.put(entry(node, 32));
  EXPECT_EQ(directory.overflows(), 1u);
  gate.open();
  directory.waitUntilIdle();
  const std::vector<Event> events = subscriber.events();
  ASSERT_EQ(events.size(), 23u);
  EXPECT_THAT(std::vector<Event>(events.begin() + 19, events.end()),
              ElementsAre(ok(20), ok(30), ok(31), overflow));
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

TEST(DirectoryOverflow, ResyncTakesThePlaceOfWhatIsDue) {
  Directory directory({1, 2});
  Gate gate;
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) gate.pass();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(node, 1));
  gate.awaitCaller();
  for (uint8_t number = 2; number <= 9; ++number) directory.put(entry(node, number));
  directory.resync();
  directory.resync();
  directory.put(entry(node, 10));
  gate.open();
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(1), resync, ok(10)));
  subscriber.unsubscribe();
  directory.waitUntilIdle();
}

/* Writers, subscribers of several speeds and small queues at once: whoever follows the events, and
 * rescans when told to, ends up with what the directory holds. */
TEST(DirectoryOverflow, WhoeverRescansLosesNothing) {
  Directory directory({3, 8});
  struct Mirror {
    explicit Mirror(Directory &directory) : subscriber(directory, every(node)) {}
    Subscriber subscriber;
    std::map<uint8_t, size_t> lengths;
  };
  std::vector<std::unique_ptr<Mirror>> mirrors;
  for (int i = 0; i < 4; ++i) {
    mirrors.push_back(std::make_unique<Mirror>(directory));
    Mirror &mirror = *mirrors.back();
    mirror.subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
      if (event.status == ZEL_OK) {
        mirror.lengths[event.number] = event.dataLength;
      } else if (event.status == ZEL_NOT_FOUND) {
        mirror.lengths.erase(event.number);
      } else if (event == overflow) {
        mirror.lengths.clear();
        for (const Entry &present : directory.entries(node)) {
          mirror.lengths[present.uuid.bytes[0]] = present.data.size();
        }
      }
    };
    ASSERT_EQ(mirror.subscriber.subscribe(), ZEL_OK);
  }
  std::vector<std::thread> writers;
  for (uint8_t writer = 0; writer < 3; ++writer) {
    writers.emplace_back([&directory, writer] {
      std::mt19937 random(writer);
      for (int i = 0; i < 3000; ++i) {
        const uint8_t number = static_cast<uint8_t>(1 + random() % 12);
        if (random() % 4 == 0) {
          directory.remove(node, uuid(number));
        } else {
          directory.put(entry(node, number, static_cast<uint8_t>(random() % 3), random() % 9));
        }
      }
    });
  }
  for (std::thread &writer : writers) writer.join();
  directory.waitUntilIdle();
  EXPECT_GT(directory.overflows(), 0u);
  std::map<uint8_t, size_t> expected;
  for (const Entry &present : directory.entries(node)) {
    expected[present.uuid.bytes[0]] = present.data.size();
  }
  for (const auto &mirror : mirrors) {
    EXPECT_EQ(mirror->lengths, expected);
    mirror->subscriber.unsubscribe();
  }
  directory.waitUntilIdle();
}

/* ---- Cancellation ---------------------------------------------------------------------------- */

TEST(DirectoryCancel, DropsWhatIsDueAndEndsWithOneLastCall) {
  Directory directory;
  Gate gate;
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) gate.pass();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  directory.put(entry(node, 1));
  gate.awaitCaller();
  directory.put(entry(node, 2));
  subscriber.unsubscribe(); /* returns although a callback is held */
  subscriber.unsubscribe(); /* not installed any more */
  directory.put(entry(node, 3));
  directory.resync();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(1)));
  EXPECT_EQ(directory.subscriptions(), 1u) << "the last call is due";
  gate.open();
  directory.waitUntilIdle();
  EXPECT_THAT(subscriber.events(), ElementsAre(ok(1), cancelled));
  EXPECT_EQ(directory.subscriptions(), 0u);
  subscriber.unsubscribe();
  directory.waitUntilIdle();
  EXPECT_EQ(subscriber.events().size(), 2u);
}

TEST(DirectoryCancel, TripleMayComeBackBeforeItsLastCall) {
  Directory directory({1, 16});
  directory.put(entry(node, 1));
  Gate gate;
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&, held = false](const Event &, const KarstEntryHeader &) mutable {
    if (!std::exchange(held, true)) gate.pass();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  gate.awaitCaller();
  subscriber.unsubscribe();
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  EXPECT_EQ(directory.subscriptions(), 2u);
  gate.open();
  directory.waitUntilIdle();
  /* Of two subscriptions: their calls have no order among each other. */
  EXPECT_THAT(subscriber.events(), testing::UnorderedElementsAre(ok(1), cancelled, ok(1)));
  EXPECT_EQ(directory.subscriptions(), 1u);
  directory.put(entry(node, 2));
  directory.waitUntilIdle();
  EXPECT_EQ(subscriber.events().back(), ok(2));
  subscriber.unsubscribe();
  directory.waitUntilIdle();
  EXPECT_EQ(subscriber.events().back(), cancelled);
  EXPECT_EQ(subscriber.events().size(), 5u);
  EXPECT_EQ(directory.subscriptions(), 0u);
}

TEST(DirectoryCancel, RacesWithDelivery) {
  Directory directory({2, 4});
  std::atomic<bool> stop{false};
  std::thread writer([&] {
    for (size_t i = 0; !stop; ++i) directory.put(entry(node, 1, 1, i % 5));
  });
  for (int round = 0; round < 500; ++round) {
    Subscriber subscriber(directory, one(node, 1));
    std::latch last{1};
    std::atomic<int> callsAfterLast{0};
    subscriber.act = [&, ended = false](const Event &event, const KarstEntryHeader &) mutable {
      if (ended) ++callsAfterLast;
      if (event != cancelled) return;
      ended = true;
      last.count_down();
    };
    ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
    subscriber.unsubscribe();
    last.wait();
    directory.waitForCallbacks(); /* the last call itself may still be on its way out */
    EXPECT_EQ(callsAfterLast, 0);
    EXPECT_EQ(subscriber.events().back(), cancelled);
  }
  stop = true;
  writer.join();
  EXPECT_EQ(directory.subscriptions(), 0u);
}

/* ---- Status callbacks ------------------------------------------------------------------------ */

class StatusListener {
 public:
  explicit StatusListener(Directory &directory) : directory_(directory) {}
  zel_Status start() { return directory_.registerStatus(called, this); }
  void end() { directory_.deregisterStatus(called, this); }
  std::vector<uint32_t> told() const {
    const std::lock_guard lock(mutex_);
    return told_;
  }
  std::function<void(uint32_t)> act;

 private:
  static void called(void *data, uint32_t status) {
    StatusListener &self = *static_cast<StatusListener *>(data);
    {
      const std::lock_guard lock(self.mutex_);
      self.told_.push_back(status);
    }
    if (self.act) self.act(status);
  }

  Directory &directory_;
  mutable std::mutex mutex_;
  std::vector<uint32_t> told_;
};

constexpr uint32_t usable = KARST_STATUS_USABLE;
constexpr uint32_t unusable = 0;

TEST(DirectoryStatus, UsableAndUnusableAlternate) {
  Directory directory;
  StatusListener early(directory), late(directory);
  ASSERT_EQ(early.start(), ZEL_OK);
  directory.setUsable(false);
  directory.waitUntilIdle();
  EXPECT_THAT(early.told(), IsEmpty()) << "unusable is where everybody starts";
  directory.setUsable(true);
  directory.setUsable(true);
  directory.waitUntilIdle();
  ASSERT_EQ(late.start(), ZEL_OK);
  directory.waitUntilIdle();
  EXPECT_THAT(late.told(), ElementsAre(usable)) << "it was usable already";
  directory.setUsable(false);
  directory.waitUntilIdle();
  directory.setUsable(true);
  directory.waitUntilIdle();
  EXPECT_THAT(early.told(), ElementsAre(usable, unusable, usable));
  early.end();
  directory.setUsable(false);
  directory.waitUntilIdle();
  EXPECT_THAT(early.told(), ElementsAre(usable, unusable, usable));
  EXPECT_THAT(late.told(), ElementsAre(usable, unusable, usable, unusable));
  late.end();
}

TEST(DirectoryStatus, InterruptionIsToldEvenWhenItIsOver) {
  Directory directory;
  Gate gate;
  StatusListener listener(directory);
  listener.act = [&, held = false](uint32_t) mutable {
    if (!std::exchange(held, true)) gate.pass();
  };
  ASSERT_EQ(listener.start(), ZEL_OK);
  directory.setUsable(true);
  gate.awaitCaller();
  for (int i = 0; i < 5; ++i) {
    directory.setUsable(false);
    directory.setUsable(true);
  }
  gate.open();
  directory.waitUntilIdle();
  EXPECT_THAT(listener.told(), ElementsAre(usable, unusable, usable));
  listener.end();
}

TEST(DirectoryStatus, DeregisteringWaitsForTheCallThatRuns) {
  Directory directory;
  Gate gate;
  StatusListener listener(directory);
  std::atomic<bool> returned{false};
  listener.act = [&](uint32_t) {
    gate.pass();
    for (int i = 0; i < 10'000; ++i) walk(directory, every(node));
    returned = true;
  };
  ASSERT_EQ(listener.start(), ZEL_OK);
  directory.setUsable(true);
  gate.awaitCaller();
  directory.setUsable(false); /* due, to be dropped */
  std::latch ready{2};
  const auto end = [&] {
    ready.count_down();
    listener.end();
    EXPECT_TRUE(returned);
  };
  std::thread one(end), other(end); /* each has the promise */
  ready.wait();
  gate.open();
  one.join();
  other.join();
  directory.waitUntilIdle();
  EXPECT_THAT(listener.told(), ElementsAre(usable));
}

TEST(DirectoryStatus, DeregisteringFromInsideTheCallReturns) {
  Directory directory;
  StatusListener listener(directory);
  listener.act = [&](uint32_t) { listener.end(); };
  ASSERT_EQ(listener.start(), ZEL_OK);
  directory.setUsable(true);
  directory.setUsable(false);
  directory.waitUntilIdle();
  directory.setUsable(true);
  directory.waitUntilIdle();
  EXPECT_THAT(listener.told(), ElementsAre(usable));
  /* And the pair may come back. */
  ASSERT_EQ(listener.start(), ZEL_OK);
  directory.waitUntilIdle();
  EXPECT_THAT(listener.told(), ElementsAre(usable, usable));
}

TEST(DirectoryStatus, DeregisteringAnUnknownPairIsAccepted) {
  Directory directory;
  StatusListener listener(directory);
  listener.end();
  directory.setUsable(true);
  directory.waitUntilIdle();
  EXPECT_THAT(listener.told(), IsEmpty());
}

/* As a module does that follows the directory only while it is usable. */
TEST(DirectoryStatus, CallbackMaySubscribeAndUnsubscribe) {
  for (const unsigned threads : {1u, 3u}) {
    Directory directory({threads, 64});
    directory.put(entry(node, 1));
    Subscriber subscriber(directory, every(node));
    StatusListener listener(directory);
    listener.act = [&](uint32_t status) {
      if (status == usable) {
        EXPECT_EQ(subscriber.subscribe(), ZEL_OK);
      } else {
        subscriber.unsubscribe();
      }
      EXPECT_EQ(directory.self(), uuid(99));
    };
    directory.setSelf(uuid(99));
    ASSERT_EQ(listener.start(), ZEL_OK);
    for (int cycle = 0; cycle < 3; ++cycle) {
      directory.setUsable(true);
      directory.waitUntilIdle();
      directory.setUsable(false);
      directory.waitUntilIdle();
    }
    EXPECT_THAT(subscriber.events(),
                ElementsAre(ok(1), cancelled, ok(1), cancelled, ok(1), cancelled));
    listener.end();
  }
}

TEST(DirectoryStatus, LongCallbackDoesNotHoldUpSubscriptions) {
  Directory directory({2, 64});
  Gate gate;
  StatusListener listener(directory);
  listener.act = [&](uint32_t) { gate.pass(); };
  ASSERT_EQ(listener.start(), ZEL_OK);
  directory.setUsable(true);
  gate.awaitCaller();
  std::latch told{10};
  Subscriber subscriber(directory, every(node));
  subscriber.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event.status == ZEL_OK) told.count_down();
  };
  ASSERT_EQ(subscriber.subscribe(), ZEL_OK);
  for (uint8_t number = 1; number <= 10; ++number) directory.put(entry(node, number));
  told.wait(); /* all of them, before the gate opens */
  subscriber.unsubscribe();
  gate.open();
  directory.waitUntilIdle();
  listener.end();
}

/* ---- The end --------------------------------------------------------------------------------- */

TEST(DirectoryEnd, MakesLastCallsAndReportsWhatIsStillInstalled) {
  std::vector<std::string> lines;
  host::setLogSink([&](const host::LogLine &line) { lines.push_back(line.text); }, true);
  auto directory = std::make_unique<Directory>(DirectorySettings{1, 16});
  Gate gate;
  Subscriber leaving(*directory, every(node)), staying(*directory, one(object, 5));
  leaving.act = [&](const Event &event, const KarstEntryHeader &) {
    if (event == ok(1)) gate.pass();
  };
  ASSERT_EQ(leaving.subscribe(), ZEL_OK);
  directory->put(entry(node, 1));
  gate.awaitCaller();
  ASSERT_EQ(staying.subscribe(), ZEL_OK);
  directory->put(entry(node, 2));
  leaving.unsubscribe();
  std::thread opener([&] { gate.open(); });
  directory.reset();
  opener.join();
  host::setLogSink({}, false);
  EXPECT_THAT(leaving.events(), ElementsAre(ok(1), cancelled));
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_THAT(lines[0], testing::HasSubstr("type 40, 05000000-0000-0000-0000-000000000000"));
}

}  // namespace
