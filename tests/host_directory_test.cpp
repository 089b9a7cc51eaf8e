/* The directory's promises: lookups and walks, what a subscription is told and in which order,
 * overflow, cancellation, status callbacks, the end. Callbacks that must be caught in the middle
 * are held; everything else waits for the directory to be idle.
 */
#include "host/directory/directory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <functional>
#include <latch>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "tests/log_lines.h"

namespace {

using host::Directory;
using host::Entry;
using testing::ElementsAre;
using Events = std::vector<std::string>;
using Numbers = std::vector<uint8_t>;

constexpr uint8_t node = KARST_TYPE_NODE, object = 40;
const std::thread::id testThread = std::this_thread::get_id();

/* UUIDs of the tests are told apart, and ordered, by their first byte. */
zel_UUID uuid(uint8_t number) {
  return {{number}};
}

Entry entry(uint8_t type, uint8_t number, uint8_t owner = 1, size_t dataLength = 0) {
  return {type, uuid(number), uuid(owner), Numbers(dataLength, number)};
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
  std::function<void(const std::string &)> act{};
  Events events{};
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
    static_cast<Listener *>(data)->take(eventText(*header, status));
    return ZEL_OK;
  }
  static void statusCalled(void *data, uint32_t status) {
    static_cast<Listener *>(data)->take(status == KARST_STATUS_USABLE ? "usable" : "unusable");
  }
  void take(const std::string &event) {
    EXPECT_FALSE(inside.exchange(true)) << "calls overlap";
    EXPECT_NE(std::this_thread::get_id(), testThread) << "not a thread of the directory";
    events.push_back(event);
    if (holding.exchange(false)) {
      reached.count_down();
      released.wait();
    }
    if (act) act(event);
    inside = false;
  }
};

/* One delivery thread, so that a callback that is held holds up everything that might be. */
class DirectoryTest : public testing::Test {
 protected:
  void put(uint8_t type, const Numbers &numbers) {
    for (const uint8_t number : numbers) directory.put(entry(type, number));
  }
  void remove(const Numbers &nodes) {
    for (const uint8_t number : nodes) directory.remove(node, uuid(number));
  }
  Numbers walk(const KarstQuery &query, const std::function<void(uint8_t)> &between = {}) {
    Numbers numbers;
    KarstEntryHeader header{};
    for (uint32_t next = 0; directory.findEntry(query, next, &header) == ZEL_OK; next = 1) {
      numbers.push_back(header.uuid.bytes[0]);
      if (between) between(numbers.back());
    }
    return numbers;
  }

  Directory directory{{1, 4}};
};

/* ---- Lookups --------------------------------------------------------------------------------- */

TEST_F(DirectoryTest, WalksOneTypeInOrderSurvivesChangesAndRefusesOtherPlaces) {
  put(node, {40, 20, 200, 30, 10});
  directory.put({node, {{40, 0, 0, 0, 0, 0, 0, 1}}, uuid(1), {}}); /* behind, by its eighth byte */
  put(node - 1, {15});
  put(node + 1, {1});
  EXPECT_EQ(walk(one(node, 30)), Numbers{30});
  EXPECT_EQ(walk(one(node, 15)), Numbers{});
  EXPECT_EQ(walk(every(node - 2)), Numbers{});
  const auto change = [&](uint8_t number) {
    if (number != 20) return;
    remove({20, 30});         /* the very place and the next one */
    put(node, {5, 25});       /* behind, so not seen, and ahead */
    KarstEntryHeader other{}; /* another walk meanwhile */
    EXPECT_EQ(directory.findEntry(every(node - 1), 0, &other), ZEL_OK);
  };
  EXPECT_EQ(walk(every(node), change), (Numbers{10, 20, 25, 40, 40, 200}));

  const KarstQuery untyped{};
  KarstEntryHeader header{};
  EXPECT_EQ(directory.subscribe(&untyped, Listener::called, nullptr), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findEntry(untyped, 0, &header), ZEL_BAD_PARAM);
  EXPECT_EQ(directory.findEntry(every(0), 1, &header), ZEL_BAD_PARAM) << "a header never filled";
  ASSERT_EQ(directory.findEntry(every(node), 0, &header), ZEL_OK);
  EXPECT_EQ(directory.findEntry(every(object), 1, &header), ZEL_BAD_PARAM) << "of another walk";
}

TEST_F(DirectoryTest, WholeEntryIsThePresentOneInABlockOfTheCallers) {
  directory.put(entry(object, 7, 2, 5));
  KarstEntryHeader header{};
  ASSERT_EQ(directory.findEntry(one(object, 7), 0, &header), ZEL_OK);
  directory.put(entry(object, 7, 3, 8));
  /* The allocator is a module's: it may look something up itself. */
  ExprMshAllocator allocator{nullptr, nullptr, nullptr, &directory};
  allocator.alloc = [](void *context, uint64_t size) {
    EXPECT_TRUE(static_cast<Directory *>(context)->entry(object, uuid(7)).has_value());
    return std::malloc(size);
  };
  KarstFullEntry *whole = nullptr;
  ASSERT_EQ(directory.findFullEntry(header, allocator, &whole), ZEL_OK);
  EXPECT_EQ(whole->header.owner, uuid(3));
  EXPECT_EQ(std::string(reinterpret_cast<char *>(whole + 1), whole->header.dataLength),
            "\7\7\7\7\7\7\7\7");
  std::free(whole);
  allocator.alloc = [](void *, uint64_t) -> void * { return nullptr; };
  EXPECT_EQ(directory.findFullEntry(header, allocator, &whole), ZEL_NO_MEMORY);
}

/* As an interface and its health have, one put right after the other. */
TEST_F(DirectoryTest, KeepsEntriesOfOneUUIDApartAndForgetsWhatIsRemoved) {
  put(object, {7});
  put(node, {7});
  EXPECT_EQ(directory.entry(object, uuid(7)), entry(object, 7));
  directory.put(entry(node, 7, 2));
  EXPECT_EQ(directory.entry(node, uuid(7)), entry(node, 7, 2));
  remove({7});
  EXPECT_FALSE(directory.entry(node, uuid(7)).has_value());
  EXPECT_EQ(directory.entry(object, uuid(7)), entry(object, 7));
}

/* ---- What subscribers are told --------------------------------------------------------------- */

TEST_F(DirectoryTest, TellsWhatIsThereThenEveryChangeInOrder) {
  put(node, {30, 10, 20});
  Listener a{directory, every(node)}, b{directory, every(node)}, single{directory, one(object, 7)};
  a.subscribeHeld();
  b.subscribe();
  single.subscribe();
  /* While the first is still being told. */
  put(node, {5, 5}); /* equal: told once */
  remove({20, 21});  /* and an unknown one */
  put(node, {7});
  put(object, {6, 7, 8});
  directory.put(entry(object, 7, 2)); /* the old pairing is gone before the new one is there */
  directory.remove(object, uuid(7));
  a.release();
  directory.waitUntilIdle();
  EXPECT_EQ(a.events, (Events{"+10", "+20", "+30", "+5", "-20", "+7"}));
  EXPECT_EQ(b.events, a.events);
  EXPECT_EQ(single.events, (Events{"-7/0", "+7", "-7", "+7/2", "-7/2"})) << "first: not there";
}

TEST_F(DirectoryTest, OverflowIsToldOnceAndDeliveryGoesOn) {
  put(node, {1, 2, 3, 4, 5}); /* more than the bound, towards which they do not count */
  Listener listener{directory, every(node)};
  listener.act = [&](const std::string &event) {
    if (event == "overflow") {
      put(node, {20}); /* its call has begun: queued again */
    } else if (event == "+20") {
      put(node, {21, 22, 23, 24, 25, 26});
      directory.resync(); /* in place of all that is due */
      put(node, {30});
    }
  };
  listener.subscribeHeld();
  put(node, {11, 12, 13, 14, 15, 16});
  EXPECT_EQ(walk(every(node)).size(), 11u) << "lookups do not wait for the call that is held";
  listener.release();
  directory.waitUntilIdle();
  EXPECT_EQ(listener.events, (Events{"+1", "+2", "+3", "+4", "+5", "+11", "+12", "+13", "+14",
                                     "overflow", "+20", "resync", "+30"}));
}

TEST_F(DirectoryTest, CancelDropsWhatIsDueAndEndsWithOneLastCall) {
  put(node, {1});
  Listener subscriber{directory, every(node)};
  subscriber.subscribeHeld();
  put(node, {2});
  subscriber.unsubscribe(); /* returns although a callback is held */
  put(node, {3});
  directory.resync();
  remove({2});
  subscriber.subscribe(); /* the same triple, before the last call of the first */
  subscriber.release();
  directory.waitUntilIdle();
  /* Calls of two subscriptions have no order among each other. */
  EXPECT_THAT(subscriber.events, testing::UnorderedElementsAre("+1", "cancelled", "+1", "+3"));
}

/* ---- Status callbacks ------------------------------------------------------------------------ */

/* A reader follows the nodes only while it is told that the directory is usable. */
TEST_F(DirectoryTest, AnInterruptionEndsInWhatWasMissedAndAResync) {
  put(node, {1, 2, 3, 4});
  Listener reader{directory, every(node)}, status{directory}, single{directory, one(node, 2)};
  const auto turn = [&](bool usable) {
    directory.setUsable(usable);
    directory.waitUntilIdle();
    return std::exchange(reader.events, {});
  };
  status.act = [&](const std::string &event) {
    event == "usable" ? reader.subscribe() : reader.unsubscribe();
    if (status.events.size() == 5) status.endStatus(); /* from inside its own call */
  };
  status.startStatus();
  remove({1}); /* there is nothing to interrupt yet */
  EXPECT_EQ(turn(true), (Events{"+2", "+3", "+4"}));
  EXPECT_EQ(turn(false), Events{"cancelled"});
  remove({2, 3});
  put(node, {3}); /* back again */
  single.subscribe();
  EXPECT_EQ(turn(true), (Events{"+2", "-2", "+3", "+4", "resync"}));
  EXPECT_EQ(single.events, (Events{"-2/0", "resync"})) << "its owner of the past is not told";
  directory.setUsable(false);
  EXPECT_EQ(turn(true), (Events{"cancelled", "+3", "+4", "resync"})) << "all was told before";
  EXPECT_EQ(turn(false), Events{}) << "nobody listens any more";
  EXPECT_EQ(status.events, (Events{"usable", "unusable", "usable", "unusable", "usable"}));
}

TEST(DirectoryEnd, MakesLastCallsAndReportsWhatIsStillInstalled) {
  const LogLines log;
  auto directory = std::make_unique<Directory>();
  directory->put(entry(node, 1));
  Listener leaving{*directory, every(node)}, staying{*directory, one(object, 5)};
  leaving.subscribeHeld();
  staying.subscribe();
  leaving.unsubscribe();
  const std::jthread opener([&] { leaving.release(); });
  directory.reset();
  EXPECT_EQ(leaving.events, (Events{"+1", "cancelled"}));
  EXPECT_THAT(log.texts,
              ElementsAre(testing::HasSubstr("type 40, 05000000-0000-0000-0000-0000000000")));
}

}  // namespace
