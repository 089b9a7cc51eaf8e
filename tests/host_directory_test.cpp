/* The directory's promises: lookups and walks, what a subscription is told and in which order,
 * overflow, cancellation, status callbacks, the end. Callbacks that must be caught in the middle
 * are held; everything else waits for the directory to be idle.
 */
#include "host/directory/directory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <latch>
#include <list>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "host/kernel/log.h"

namespace {

using host::Directory;
using host::Entry;
using testing::ElementsAre;

constexpr uint8_t node = KARST_TYPE_NODE, object = 40;
const std::thread::id testThread = std::this_thread::get_id();

/* UUIDs of the tests are told apart, and ordered, by their first byte. */
zel_UUID uuid(uint8_t number) {
  return {{number}};
}

Entry entry(uint8_t type, uint8_t number, uint8_t owner = 1, size_t dataLength = 0) {
  return {type, uuid(number), uuid(owner), std::vector<uint8_t>(dataLength, number)};
}

KarstQuery one(uint8_t type, uint8_t number, uint8_t flags = 0) {
  KarstQuery query{};
  query.type = type;
  query.uuid = uuid(number);
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_REPLICA | flags;
  return query;
}

KarstQuery every(uint8_t type) {
  return one(type, 0, KARST_QUERY_ALL);
}

/* "+7" for entry 7 of owner 1, "+7/2" where the owner is 2, "-7" when it is gone. */
std::string eventText(const KarstEntryHeader &header, zel_Status status) {
  if (status == ZEL_SUB_OVERFLOW) return "overflow";
  if (status == ZEL_SUB_RESYNC) return "resync";
  if (status == ZEL_SUB_CANCELLED) return "cancelled";
  const unsigned owner = header.owner.bytes[0];
  return (status == ZEL_OK ? "+" : "-") + std::to_string(header.uuid.bytes[0]) +
         (owner != 1 ? "/" + std::to_string(owner) : "");
}

/* A subscriber, and a listener to the status, that keeps what it is told; to be read while none of
 * its calls goes on. The first call of one that holds waits to be released. */
struct Listener {
  Directory &directory;
  const KarstQuery query{};
  std::function<void(const std::string &, const KarstEntryHeader &)> act{};
  std::vector<std::string> events{};
  std::latch reached{1}, released{1};
  std::atomic<bool> holding{false}, inside{false};

  void subscribe() { EXPECT_EQ(directory.subscribe(&query, called, this), ZEL_OK); }
  void unsubscribe() { directory.unsubscribe(&query, called, this); }
  void startStatus() { EXPECT_EQ(directory.registerStatus(statusCalled, this), ZEL_OK); }
  void endStatus() { directory.deregisterStatus(statusCalled, this); }
  void subscribeHeld() { /* something must be there to be told of */
    holding = true;
    subscribe();
    reached.wait();
  }
  void release() { released.count_down(); }

  static zel_Status called(void *data, const KarstEntryHeader *header, void *, zel_Status status) {
    static_cast<Listener *>(data)->take(eventText(*header, status), *header);
    return ZEL_OK;
  }
  static void statusCalled(void *data, uint32_t status) {
    static_cast<Listener *>(data)->take(status == KARST_STATUS_USABLE ? "usable" : "unusable", {});
  }
  void take(const std::string &event, const KarstEntryHeader &header) {
    EXPECT_FALSE(inside.exchange(true)) << "calls overlap";
    EXPECT_NE(std::this_thread::get_id(), testThread) << "not a thread of the directory";
    events.push_back(event);
    if (holding.exchange(false)) {
      reached.count_down();
      released.wait();
    }
    if (act) act(event, header);
    inside = false;
  }
};

/* One delivery thread, so that a callback that is held holds up everything that might be. */
class DirectoryTest : public testing::Test {
 protected:
  void putNodes(const std::vector<uint8_t> &numbers) {
    for (const uint8_t number : numbers) directory.put(entry(node, number));
  }
  void turn(bool isUsable) {
    directory.setUsable(isUsable);
    directory.waitUntilIdle();
  }
  std::vector<unsigned> walk(
      const KarstQuery &query, const std::function<void(unsigned)> &between = [](unsigned) {}) {
    std::vector<unsigned> numbers;
    KarstEntryHeader header{};
    for (uint32_t next = 0; directory.findEntry(query, next, &header) == ZEL_OK; next = 1) {
      numbers.push_back(header.uuid.bytes[0]);
      between(numbers.back());
    }
    return numbers;
  }

  Directory directory{{1, 4}};
};

/* ---- Lookups --------------------------------------------------------------------------------- */

TEST_F(DirectoryTest, WalksOneTypeInOrderAndSurvivesChanges) {
  putNodes({40, 20, 200, 30, 10});
  directory.put(entry(node - 1, 15));
  directory.put(entry(node + 1, 1));
  EXPECT_THAT(walk(every(node)), ElementsAre(10, 20, 30, 40, 200));
  EXPECT_THAT(walk(one(node, 30)), ElementsAre(30));
  EXPECT_THAT(walk(one(node, 15)), ElementsAre());
  const auto change = [&](unsigned number) {
    if (number != 20) return;
    directory.remove(node, uuid(20)); /* the very place */
    directory.remove(node, uuid(30)); /* the next one */
    putNodes({5, 25});                /* behind, so not seen, and ahead */
  };
  EXPECT_THAT(walk(every(node), change), ElementsAre(10, 20, 25, 40, 200));
}

TEST_F(DirectoryTest, BadQueriesAndPlacesAreRefused) {
  putNodes({1});
  const KarstQuery untyped{};
  KarstEntryHeader header{};
  EXPECT_EQ(directory.findEntry(untyped, 0, &header), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.subscribe(&untyped, Listener::called, nullptr), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findEntry(every(node), 2, &header), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findEntry(every(node), 1, &header), ZEL_BAD_PARAM) << "a header never filled";
  ASSERT_EQ(directory.findEntry(every(node), 0, &header), ZEL_OK);
  EXPECT_EQ(directory.findEntry(every(object), 1, &header), ZEL_BAD_PARAM) << "of another walk";
}

TEST_F(DirectoryTest, WholeEntryIsThePresentOneInABlockOfTheCallers) {
  directory.put(entry(object, 7, 2, 5));
  directory.put(entry(node, 7, 9, 1)); /* the same UUID, another type */
  KarstEntryHeader header{};
  ASSERT_EQ(directory.findEntry(one(object, 7), 0, &header), ZEL_OK);
  EXPECT_EQ(header.owner, uuid(2));
  directory.put(entry(object, 7, 3, 8));
  /* The allocator is a module's: it may look something up itself, and it may fail. */
  ExprMshAllocator allocator{nullptr, nullptr, nullptr, &directory};
  allocator.alloc = [](void *context, uint64_t size) {
    const bool there = static_cast<Directory *>(context)->entry(object, uuid(7)).has_value();
    return there ? std::malloc(size) : nullptr;
  };
  KarstFullEntry *whole = nullptr;
  ASSERT_EQ(directory.findFullEntry(header, allocator, &whole), ZEL_OK);
  EXPECT_EQ(whole->header.owner, uuid(3));
  ASSERT_EQ(whole->header.dataLength, 8u);
  EXPECT_EQ(std::memcmp(whole + 1, "\7\7\7\7\7\7\7\7", 8), 0);
  std::free(whole);
  directory.remove(object, uuid(7));
  EXPECT_EQ(directory.findFullEntry(header, allocator, &whole), ZEL_NOT_FOUND);
  EXPECT_EQ(directory.findFullEntry(one(node, 7), allocator, &whole), ZEL_NO_MEMORY);
}

/* ---- What subscribers are told --------------------------------------------------------------- */

TEST_F(DirectoryTest, TellsWhatIsThereThenEveryChangeInOrderAndInTurn) {
  putNodes({30, 10, 20});
  std::string turns;
  Listener a{directory, every(node)}, b{directory, every(node)}, single{directory, one(object, 7)};
  a.act = [&](const std::string &, const KarstEntryHeader &) { turns += 'a'; };
  b.act = [&](const std::string &, const KarstEntryHeader &) { turns += 'b'; };
  a.subscribeHeld();
  b.subscribe();
  single.subscribe();
  /* While the first is still being told. */
  putNodes({5, 5}); /* equal: told once */
  directory.remove(node, uuid(20));
  directory.remove(node, uuid(21)); /* unknown */
  putNodes({7});
  for (uint8_t number : {6, 7, 8}) directory.put(entry(object, number));
  directory.put(entry(object, 7, 2)); /* the old pairing is gone before the new one is there */
  directory.remove(object, uuid(7));
  a.release();
  directory.waitUntilIdle();
  EXPECT_THAT(a.events, ElementsAre("+10", "+20", "+30", "+5", "-20", "+7"));
  EXPECT_EQ(b.events, a.events);
  EXPECT_THAT(single.events, ElementsAre("-7/0", "+7", "-7", "+7/2", "-7/2")) << "first: not there";
  EXPECT_EQ(turns, "abababababab");
}

TEST_F(DirectoryTest, OverflowIsToldOnceAndDeliveryGoesOn) {
  putNodes({1, 2, 3, 4, 5}); /* more than the bound, towards which they do not count */
  Listener listener{directory, every(node)};
  listener.act = [&](const std::string &event, const KarstEntryHeader &) {
    if (event == "overflow") {
      putNodes({20}); /* its call has begun: queued again */
      EXPECT_EQ(walk(every(node)).size(), 12u);
    } else if (event == "+20") {
      putNodes({21, 22, 23, 24, 25, 26});
      directory.resync(); /* in place of all that is due */
      directory.resync();
      putNodes({30});
    }
  };
  listener.subscribeHeld();
  putNodes({11, 12, 13, 14});
  putNodes({15, 16});
  EXPECT_EQ(walk(every(node)).size(), 11u) << "lookups do not wait for the call that is held";
  listener.release();
  directory.waitUntilIdle();
  EXPECT_THAT(listener.events, ElementsAre("+1", "+2", "+3", "+4", "+5", "+11", "+12", "+13", "+14",
                                           "overflow", "+20", "resync", "+30"));
}

/* ---- Cancellation ---------------------------------------------------------------------------- */

TEST_F(DirectoryTest, CancelDropsWhatIsDueAndEndsWithOneLastCall) {
  putNodes({1});
  Listener subscriber{directory, every(node)};
  subscriber.subscribeHeld();
  putNodes({2});
  subscriber.unsubscribe(); /* returns although a callback is held */
  subscriber.unsubscribe(); /* not installed any more */
  putNodes({3});
  directory.resync();
  EXPECT_EQ(directory.subscriptions(), 1u) << "the last call is due";
  directory.remove(node, uuid(2));
  subscriber.subscribe(); /* the same triple, before the last call of the first */
  EXPECT_EQ(directory.subscriptions(), 2u);
  subscriber.release();
  directory.waitUntilIdle();
  /* Calls of two subscriptions have no order among each other. */
  EXPECT_THAT(subscriber.events, testing::UnorderedElementsAre("+1", "cancelled", "+1", "+3"));
}

/* Writers, subscribers that come and go and small queues at once: a last call is the last, and
 * whoever follows the events, and rescans when told to, ends up with what the directory holds. */
TEST(DirectoryRaces, NothingIsLostAndNothingComesLate) {
  Directory directory({3, 8});
  const auto contents = [&] {
    std::map<uint8_t, size_t> lengths;
    for (const Entry &e : directory.entries(node)) lengths[e.uuid.bytes[0]] = e.data.size();
    return lengths;
  };
  std::map<uint8_t, size_t> mirrors[3];
  std::list<Listener> subscribers;
  for (auto &mirror : mirrors) {
    Listener &subscriber = subscribers.emplace_back(directory, every(node));
    subscriber.act = [&](const std::string &event, const KarstEntryHeader &header) {
      if (event[0] == '+') mirror[header.uuid.bytes[0]] = header.dataLength;
      if (event[0] == '-') mirror.erase(header.uuid.bytes[0]);
      if (event == "overflow") mirror = contents();
    };
    subscriber.subscribe();
  }
  std::vector<std::jthread> writers;
  for (const unsigned seed : {1u, 2u, 3u}) {
    writers.emplace_back([&, random = std::mt19937(seed)](const std::stop_token &stop) mutable {
      while (!stop.stop_requested()) {
        const uint8_t number = static_cast<uint8_t>(1 + random() % 12);
        directory.put(entry(node, number, static_cast<uint8_t>(random() % 3), random() % 9));
        if (random() % 4 == 0) directory.remove(node, uuid(number));
      }
    });
  }
  for (int round = 0; round < 500; ++round) {
    Listener brief{directory, every(node)};
    brief.subscribe();
    brief.unsubscribe();
    while (directory.subscriptions() > std::size(mirrors)) directory.waitForCallbacks();
    EXPECT_EQ(brief.events.back(), "cancelled");
  }
  writers.clear();
  directory.waitUntilIdle();
  EXPECT_GT(directory.overflows(), 0u);
  EXPECT_THAT(mirrors, testing::Each(contents()));
}

/* ---- Status callbacks ------------------------------------------------------------------------ */

TEST_F(DirectoryTest, UsableAndUnusableAlternate) {
  putNodes({1});
  Listener early{directory, {}}, late{directory, {}}, holder{directory, every(node)};
  early.startStatus();
  for (const bool isUsable : {false, true, true}) turn(isUsable); /* two of them are no turns */
  late.startStatus(); /* told at once that it is usable already */
  holder.subscribeHeld();
  for (const bool isUsable : {false, true, false, true}) directory.setUsable(isUsable);
  holder.release();
  directory.waitUntilIdle();
  early.endStatus();
  turn(false);
  EXPECT_THAT(early.events, ElementsAre("usable", "unusable", "usable")) << "one interruption";
  EXPECT_THAT(late.events, ElementsAre("usable", "unusable", "usable", "unusable"));
}

/* A reader that follows the nodes only while it is told that the directory is usable. */
class DirectoryInterruption : public DirectoryTest {
 protected:
  void SetUp() override {
    status.act = [&](const std::string &event, const KarstEntryHeader &) {
      event == "usable" ? reader.subscribe() : reader.unsubscribe();
    };
    status.startStatus();
  }

  Listener status{directory, {}}, reader{directory, every(node)}, other{directory, every(node)};
};

TEST_F(DirectoryInterruption, EndsInWhatWasMissedAndAResync) {
  putNodes({1, 2, 3, 4});
  Listener later{directory, {}}, single{directory, one(node, 2)};
  later.act = [&](const std::string &, const KarstEntryHeader &) {
    EXPECT_THAT(other.events, testing::Not(testing::Contains("resync"))) << "not all know yet";
    if (later.events.size() == 3) directory.remove(node, uuid(4));
  };
  later.startStatus();
  other.subscribe();
  directory.remove(node, uuid(1)); /* there is nothing to interrupt yet */
  turn(true);
  EXPECT_THAT(reader.events, ElementsAre("+2", "+3", "+4"));
  turn(false);
  for (const uint8_t number : {2, 3}) directory.remove(node, uuid(number));
  putNodes({3}); /* back again */
  single.subscribe();
  directory.waitUntilIdle();
  reader.events.clear();
  turn(true);
  EXPECT_THAT(reader.events, ElementsAre("+2", "-2", "+3", "+4", "resync"));
  EXPECT_THAT(single.events, ElementsAre("-2/0", "resync")) << "its owner of the past is not told";
  EXPECT_THAT(other.events, ElementsAre("+1", "+2", "+3", "+4", "-1", "-2", "-3", "+3", "resync"));
  later.endStatus();
  reader.events.clear();
  for (const bool isUsable : {false, true}) turn(isUsable);
  EXPECT_THAT(reader.events, ElementsAre("cancelled", "+3", "resync")) << "all was told before";
  status.endStatus();
  for (const bool isUsable : {false, true}) turn(isUsable);
  EXPECT_EQ(reader.events.back(), "resync") << "nobody had to be told first";
  EXPECT_EQ(reader.events.size(), 4u);
}

TEST_F(DirectoryInterruption, KeepsWhatAnInterruptionDropped) {
  putNodes({1, 2, 3});
  other.act = [&](const std::string &event, const KarstEntryHeader &) {
    if (event == "resync" && other.events.size() == 6) directory.setUsable(false);
  };
  other.subscribe();
  directory.waitUntilIdle();
  reader.holding = true;
  directory.setUsable(true);
  reader.reached.wait(); /* in its first call */
  for (const uint8_t number : {2, 3}) directory.remove(node, uuid(number));
  directory.setUsable(false);
  reader.release();
  directory.waitUntilIdle();
  EXPECT_THAT(reader.events, ElementsAre("+1", "cancelled")) << "before it was told the removals";
  turn(true); /* unusable again as soon as that is known, and before the reader was told all */
  EXPECT_THAT(reader.events, testing::Not(testing::Contains("-3")));
  reader.events.clear();
  turn(true);
  EXPECT_THAT(reader.events, ElementsAre("+2", "-2", "+3", "-3", "+1", "resync"));
}

TEST(DirectoryStatus, LongCallHoldsUpItsDeregistrationAndNoSubscription) {
  Directory directory;
  directory.put(entry(node, 1));
  Listener listener{directory, {}}, subscriber{directory, every(node)};
  std::atomic<bool> returned{false};
  listener.act = [&](const std::string &, const KarstEntryHeader &) {
    for (int i = 0; i < 10'000; ++i) directory.put(entry(object, 1, 1, i % 2));
    returned = true;
  };
  listener.holding = true;
  listener.startStatus();
  directory.setUsable(true);
  listener.reached.wait();
  subscriber.subscribeHeld(); /* called before the other is released */
  subscriber.release();
  std::latch ready{2};
  const auto end = [&] {
    ready.count_down();
    listener.endStatus();
    EXPECT_TRUE(returned);
  };
  {
    const std::jthread first(end), second(end); /* each has the promise */
    ready.wait();
    listener.release();
  }
}

/* As a module does that follows the directory only while it is usable. */
TEST_F(DirectoryTest, CallbacksMaySubscribeUnsubscribeAndDeregister) {
  putNodes({1});
  directory.put(entry(object, 2));
  Listener status{directory, {}}, outer{directory, every(node)}, inner{directory, every(object)};
  outer.act = [&](const std::string &event, const KarstEntryHeader &) {
    if (event == "+1") inner.subscribe();
    if (event == "-1") outer.unsubscribe(); /* from inside its own call */
    if (event == "cancelled") inner.unsubscribe();
  };
  status.act = [&](const std::string &event, const KarstEntryHeader &) {
    event == "usable" ? outer.subscribe() : outer.unsubscribe();
    if (status.events.size() != 3) return;
    directory.setUsable(false); /* due, and dropped */
    status.endStatus();
  };
  status.startStatus();
  for (const bool isUsable : {true, false, true}) turn(isUsable);
  directory.remove(node, uuid(1));
  directory.waitUntilIdle();
  EXPECT_THAT(status.events, ElementsAre("usable", "unusable", "usable"));
  EXPECT_THAT(outer.events, ElementsAre("+1", "cancelled", "+1", "-1", "cancelled"));
  EXPECT_THAT(inner.events, ElementsAre("+2", "cancelled", "+2", "cancelled"));
}

TEST(DirectoryEnd, MakesLastCallsAndReportsWhatIsStillInstalled) {
  std::vector<std::string> lines;
  host::setLogSink([&](const host::LogLine &line) { lines.push_back(line.text); }, true);
  auto directory = std::make_unique<Directory>();
  directory->put(entry(node, 1));
  Listener leaving{*directory, every(node)}, staying{*directory, one(object, 5)};
  leaving.subscribeHeld();
  staying.subscribe();
  leaving.unsubscribe();
  const std::jthread opener([&] { leaving.release(); });
  directory.reset();
  host::setLogSink({}, false);
  EXPECT_THAT(leaving.events, ElementsAre("+1", "cancelled"));
  EXPECT_THAT(lines,
              ElementsAre(testing::HasSubstr("type 40, 05000000-0000-0000-0000-0000000000")));
}

}  // namespace
