/* The host kernel's own services (UUIDs, text, heaps, log, panic, frames) and the kernel as a
 * whole, with the resolver and the example client module loaded into it.
 */
#include "host/host_kernel.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include <random>
#include <thread>

#include "host/directory/records.h"
#include "host/kernel/frames.h"
#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "karst_resolver/karst_resolver.h"
#include "platform/qxt.h"
#include "platform/tolm.h"

namespace {

using testing::AllOf;
using testing::ContainsRegex;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;

/* Keeps the log's lines while it lives, in place of standard error. */
class LogLines {
 public:
  LogLines() {
    host::setLogSink([this](const host::LogLine &line) { lines_.push_back(line); }, true);
  }
  ~LogLines() { host::setLogSink({}, false); }
  LogLines(const LogLines &) = delete;
  LogLines &operator=(const LogLines &) = delete;

  /* Only when nothing logs any more. */
  const std::vector<host::LogLine> &all() const { return lines_; }
  std::vector<std::string> texts() const {
    std::vector<std::string> texts;
    for (const host::LogLine &line : lines_) texts.push_back(line.text);
    return texts;
  }

 private:
  std::vector<host::LogLine> lines_;
};

zel_HeapProps heapProps(const char *name, uint32_t maximum, uint32_t initial = 0) {
  zel_HeapProps props{};
  zel_NameInitialize(&props.name, name);
  props.initialSize = initial;
  props.maximumSize = maximum;
  return props;
}

/* A heap that ends with its scope; a test that leaves blocks in it does so on purpose. */
class TestHeap {
 public:
  explicit TestHeap(uint32_t maximum) {
    const zel_HeapProps props = heapProps("test", maximum);
    EXPECT_EQ(zel_HeapCreate(&props, &id_), ZEL_OK);
  }
  ~TestHeap() { zel_HeapDestroy(id_); }
  TestHeap(const TestHeap &) = delete;
  TestHeap &operator=(const TestHeap &) = delete;

  void *allocate(uint32_t size) { return zel_HeapAllocWithRA(id_, size, nullptr); }
  void free(void *block) { zel_HeapFree(id_, block); }
  zel_HeapID id() const { return id_; }
  host::HeapState state() const { return host::heapState(id_); }

 private:
  zel_HeapID id_ = ZEL_NO_HEAP;
};

/* ---- UUIDs and text -------------------------------------------------------------------------- */

TEST(UUID, IsReadAndPrintedInByteOrder) {
  const auto uuid = host::parseUUID("00112233-4455-6677-8899-aAbBcCdDeEfF");
  ASSERT_TRUE(uuid.has_value());
  for (unsigned i = 0; i < 16; i++) EXPECT_EQ(uuid->bytes[i], i * 0x11);
  EXPECT_EQ(host::toString(*uuid), "00112233-4455-6677-8899-aabbccddeeff");
  EXPECT_EQ(host::parseUUID("00112233445566778899aabbccddeeff"), uuid);
}

TEST(UUID, AcceptsNothingElse) {
  for (const char *text :
       {"", "0", "00112233-4455-6677-8899-aabbccddeef", "00112233-4455-6677-8899-aabbccddeefff",
        "0011223-34455-6677-8899-aabbccddeeff", "00112233-4455-6677-8899-aabbccddeegg",
        "{0112233-4455-6677-8899-aabbccddeef}", " 0112233445566778899aabbccddeeff",
        "00112233+4455-6677-8899-aabbccddeeff", "-0112233-4455-6677-8899-aabbccddeeff"}) {
    EXPECT_FALSE(host::parseUUID(text).has_value()) << text;
  }
}

TEST(UUID, IsOrderedByItsBytes) {
  const zel_UUID low = *host::parseUUID("00000000-0000-0000-0000-0000000000ff");
  const zel_UUID high = *host::parseUUID("01000000-0000-0000-0000-000000000000");
  EXPECT_LT(low, high);
  EXPECT_TRUE(host::isZero(zel_UUID{}));
  EXPECT_FALSE(host::isZero(low));
}

TEST(Text, NamesStatuses) {
  EXPECT_STREQ(zel_StatusToString(ZEL_OK), "ZEL_OK");
  EXPECT_STREQ(zel_StatusToString(0x0bad0014), "ZEL_NO_MEMORY");
  EXPECT_STREQ(zel_StatusToString(0x0bad0113), "ZEL_SUB_RESYNC");
  EXPECT_STREQ(zel_StatusToString(EXPR_MSH_OUT_OF_RANGE), "EXPR_MSH_OUT_OF_RANGE");
  EXPECT_STREQ(zel_StatusToString(0x0bad0002), "unknown status");
}

TEST(Text, CutsNamesAndZeroesTheRest) {
  zel_Name name;
  std::memset(&name, 0xee, sizeof name);
  zel_NameInitialize(&name, "abc");
  EXPECT_EQ(std::string(name.text, sizeof name.text), std::string("abc") + std::string(29, '\0'));
  zel_NameInitialize(&name, "0123456789012345678901234567890123456789");
  EXPECT_STREQ(name.text, "0123456789012345678901234567890");
}

TEST(Text, FormatsLikeC99) {
  char buffer[8] = "xxxxxxx";
  EXPECT_EQ(zel_Snprintf(buffer, sizeof buffer, "%s-%d", "karst", 1234), 10);
  EXPECT_STREQ(buffer, "karst-1");
}

/* ---- Heaps ----------------------------------------------------------------------------------- */

TEST(Heap, HoldsExactlyWhatTheSizingFunctionSays) {
  for (const uint32_t size : {0u, 1u, 15u, 16u, 17u, 392u, 4096u}) {
    constexpr uint32_t blocks = 10;
    const uint32_t space = tolmapi_HeapRequest2Size(size);
    EXPECT_GT(space, size);
    TestHeap heap(blocks * space);
    std::vector<void *> taken;
    for (uint32_t i = 0; i < blocks; i++) {
      taken.push_back(heap.allocate(size));
      ASSERT_NE(taken.back(), nullptr);
      EXPECT_EQ(reinterpret_cast<uintptr_t>(taken.back()) % 16, 0u);
      EXPECT_EQ(heap.state().used, (i + 1) * space);
    }
    EXPECT_EQ(heap.allocate(0), nullptr) << "the heap is full";
    heap.free(taken[3]);
    EXPECT_EQ(heap.allocate(size + 16), nullptr) << "only " << size << " bytes are free";
    taken[3] = heap.allocate(size);
    EXPECT_NE(taken[3], nullptr);
    for (void *block : taken) heap.free(block);
    EXPECT_EQ(heap.state().used, 0u);
    EXPECT_EQ(heap.state().peak, blocks * space);
  }
}

TEST(Heap, LargestRequestsDoNotWrapAround) {
  TestHeap heap(0xffffffff);
  for (const uint32_t size : {0xffffffffu, 0xfffffff0u, 0xffffffe0u}) {
    EXPECT_GE(tolmapi_HeapRequest2Size(size), size);
  }
  TestHeap small(4096);
  EXPECT_EQ(small.allocate(0xffffffff), nullptr);
  EXPECT_EQ(small.allocate(0xfffffff0), nullptr);
  EXPECT_EQ(small.state().used, 0u);
}

TEST(Heap, RemembersSizeAndAskerOfEachBlockOldestFirst) {
  TestHeap heap(4096);
  int places[3];
  void *const first = zel_HeapAllocWithRA(heap.id(), 7, &places[0]);
  void *const second = zel_HeapAllocWithRA(heap.id(), 8, &places[1]);
  void *const third = zel_HeapAllocWithRA(heap.id(), 9, &places[2]);
  heap.free(second);
  const host::HeapState state = heap.state();
  ASSERT_EQ(state.blocks.size(), 2u);
  EXPECT_EQ(state.blocks[0].address, first);
  EXPECT_EQ(state.blocks[0].size, 7u);
  EXPECT_EQ(state.blocks[0].returnAddress, &places[0]);
  EXPECT_EQ(state.blocks[1].address, third);
  EXPECT_EQ(state.blocks[1].returnAddress, &places[2]);
  EXPECT_EQ(state.allocations, 3u);
  heap.free(first);
  heap.free(third);
}

TEST(Heap, IsRefusedWithSizesThatContradict) {
  zel_HeapID heap = 77;
  zel_HeapProps props = heapProps("bad", 4096, 4097);
  EXPECT_EQ(zel_HeapCreate(&props, &heap), ZEL_BAD_PARAM);
  props = heapProps("bad", 0);
  EXPECT_EQ(zel_HeapCreate(&props, &heap), ZEL_BAD_PARAM);
  EXPECT_EQ(heap, 77u);
  EXPECT_THAT(host::heapsAlive(), IsEmpty());
}

TEST(Heap, ReportsAtItsEndWhatIsAliveAndWhoAskedForIt) {
  LogLines log;
  {
    TestHeap heap(4096);
    heap.free(heap.allocate(100));
    const auto asker = reinterpret_cast<char *>(&host::setLogThreshold) + 4;
    zel_HeapAllocWithRA(heap.id(), 24, asker);
    zel_HeapAllocWithRA(heap.id(), 40, asker);
  }
  EXPECT_THAT(log.texts(),
              ElementsAre(AllOf(HasSubstr("heap test: block of 24 bytes"),
                                HasSubstr("host::setLogThreshold(host::LogThreshold)+0x4")),
                          HasSubstr("block of 40 bytes"),
                          "heap test: 2 blocks of 64 bytes in total were alive at its end"));
}

TEST(Heap, KeepsItsAccountsUnderManyThreads) {
  constexpr unsigned kThreads = 4;
  TestHeap heap(64 * tolmapi_HeapRequest2Size(256));
  std::vector<std::thread> threads;
  for (unsigned seed = 0; seed < kThreads; seed++) {
    threads.emplace_back([&heap, seed] {
      std::mt19937 random(seed);
      std::vector<unsigned char *> own;
      for (int step = 0; step < 20000; step++) {
        if (own.size() == 40 || (random() % 2 == 0 && !own.empty())) {
          std::swap(own[random() % own.size()], own.back());
          ASSERT_EQ(*own.back(), seed);
          heap.free(own.back());
          own.pop_back();
        } else if (auto *block = static_cast<unsigned char *>(heap.allocate(1 + random() % 256))) {
          *block = static_cast<unsigned char>(seed);
          own.push_back(block);
        }
      }
      for (unsigned char *block : own) heap.free(block);
    });
  }
  for (std::thread &thread : threads) thread.join();
  const host::HeapState state = heap.state();
  EXPECT_EQ(state.used, 0u);
  EXPECT_THAT(state.blocks, IsEmpty());
  EXPECT_LE(state.peak, state.maximum);
}

TEST(HeapDeathTest, StopsOnBlocksThatAreNotAlive) {
  TestHeap heap(4096);
  TestHeap other(4096);
  void *const block = heap.allocate(16);
  void *const gone = heap.allocate(16);
  heap.free(nullptr);
  heap.free(gone);
  EXPECT_DEATH(heap.free(gone), "panic: freeing 0x[0-9a-f]+, which is not alive in heap");
  EXPECT_DEATH(heap.free(static_cast<char *>(block) + 16), "is not alive in heap");
  EXPECT_DEATH(other.free(block), "is not alive in heap");
  EXPECT_DEATH(zel_HeapAllocWithRA(0x123456, 16, nullptr), "there is no heap 0x123456");
  EXPECT_DEATH(zel_HeapDestroy(ZEL_NO_HEAP), "there is no heap 0x0");
  heap.free(block);
}

/* ---- Log ------------------------------------------------------------------------------------- */

TEST(Log, GoesToStandardErrorWithLevelThreadAndOneNewline) {
  testing::internal::CaptureStderr();
  std::thread([] {
    pthread_setname_np(pthread_self(), "scribe");
    zel_LogNoLevel(ZEL_LOG_URGENCY_INFO, "count {} %d\n", 3);
    zel_LogNoLevel(ZEL_LOG_URGENCY_WARNING, "no newline");
  }).join();
  const std::string text = testing::internal::GetCapturedStderr();
  const std::string stamp = "[0-9]{4}-[0-9]{2}-[0-9]{2} [0-9:]{8}\\.[0-9]{3} ";
  EXPECT_THAT(text, testing::MatchesRegex(stamp + "info \\[scribe\\] count \\{\\} 3\n" + stamp +
                                          "warning \\[scribe\\] no newline\n"));
}

TEST(Log, ShowsWhatTheThresholdAllowsAndGivesASinkEverything) {
  std::vector<std::string> seen;
  host::setLogSink([&](const host::LogLine &line) { seen.push_back(line.text); }, false);
  testing::internal::CaptureStderr();
  host::setLogThreshold(host::LogThreshold::Warning);
  host::logInfo("quiet");
  host::logWarning("loud");
  host::setLogThreshold(host::LogThreshold::Off);
  host::logWarning("mute");
  host::setLogThreshold(host::LogThreshold::Info);
  const std::string text = testing::internal::GetCapturedStderr();
  host::setLogSink({}, false);
  EXPECT_THAT(text, AllOf(HasSubstr("loud"), Not(HasSubstr("quiet")), Not(HasSubstr("mute"))));
  EXPECT_THAT(seen, ElementsAre("quiet", "loud", "mute"));
}

TEST(Log, OfAModuleFiltersByItsLevel) {
  LogLines lines;
  zel_Log *log = nullptr;
  ASSERT_EQ(Tolm_LogInit("Resolver", 3, 2, 0, &log), ZEL_OK);
  EXPECT_STREQ(zel_LogGetName(log), "Resolver");
  EXPECT_EQ(zel_LogGetCurrentLogLevel(log), 2);
  EXPECT_THAT(host::logsOpen(), ElementsAre("Resolver"));
  zel_LogLevel(ZEL_LOG_URGENCY_WARNING, log, 2, "%s\n", "at the level");
  zel_LogLevel(ZEL_LOG_URGENCY_WARNING, log, 3, "above the level\n");
  Tolm_LogCleanup(&log);
  EXPECT_EQ(log, nullptr);
  EXPECT_THAT(host::logsOpen(), IsEmpty());
  ASSERT_EQ(lines.all().size(), 1u);
  EXPECT_EQ(lines.all()[0].text, "at the level");
  EXPECT_EQ(lines.all()[0].urgency, ZEL_LOG_URGENCY_WARNING);
  EXPECT_EQ(lines.all()[0].log, "Resolver");
}

/* ---- Panic and frames ------------------------------------------------------------------------ */

TEST(PanicDeathTest, TellsMessageReportAndBacktrace) {
  EXPECT_DEATH(
      {
        host::setPanicReport([] { return std::string("the history"); });
        host::panic("out of %s", "luck");
      },
      "panic: out of luck\nthe history\nbacktrace:\n(.*\n)*.*host::panic");
  EXPECT_DEATH(zel_PanicWithModuleID(4711, "Failed at %s:%d", "file", 12),
               "panic: module 4711: Failed at file:12");
}

TEST(PanicDeathTest, InsideItsOwnReportStillEnds) {
  host::setPanicReport([]() -> std::string { host::panic("second"); });
  EXPECT_DEATH(host::panic("first"), "panic: first\npanic: second");
  host::setPanicReport({});
}

struct Returns {
  uint64_t seen[3]; /* by the compiler, in each function */
  uint64_t asked[3];
};

__attribute__((noinline)) void innermost(Returns *returns) {
  returns->seen[0] = reinterpret_cast<uint64_t>(__builtin_return_address(0));
  for (uint32_t frame = 0; frame < 3; frame++) {
    returns->asked[frame] = tolmapi_GetReturnAddress(frame);
  }
}

__attribute__((noinline)) void middle(Returns *returns) {
  returns->seen[1] = reinterpret_cast<uint64_t>(__builtin_return_address(0));
  innermost(returns);
  asm volatile("" ::: "memory"); /* keeps the call a call */
}

__attribute__((noinline)) void outermost(Returns *returns) {
  returns->seen[2] = reinterpret_cast<uint64_t>(__builtin_return_address(0));
  middle(returns);
  asm volatile("" ::: "memory");
}

TEST(Frames, TellWhereEachCallerReturnsTo) {
  Returns returns{};
  outermost(&returns);
  for (int frame = 0; frame < 3; frame++) EXPECT_EQ(returns.asked[frame], returns.seen[frame]);
  EXPECT_NE(returns.seen[0], returns.seen[1]);
}

TEST(Frames, EndWhereTheChainLeadsNowhere) {
  struct {
    uintptr_t outer, returnAddress;
  } frames[2] = {};
  frames[0] = {reinterpret_cast<uintptr_t>(&frames[1]), 11};
  const auto second = [&](uintptr_t outer) {
    frames[1] = {outer, 22};
    return host::returnAddressOf(&frames[0], 2);
  };
  EXPECT_EQ(host::returnAddressOf(&frames[0], 0), 11u);
  EXPECT_EQ(second(0), 0u);
  EXPECT_EQ(host::returnAddressOf(&frames[0], 1), 22u);
  EXPECT_EQ(second(reinterpret_cast<uintptr_t>(&frames[0])), 0u) << "a circle";
  EXPECT_EQ(second(0x7ffffffffff0), 0u) << "nothing is mapped there";
  EXPECT_EQ(second(reinterpret_cast<uintptr_t>(&frames[1]) + 17), 0u) << "not aligned";
  EXPECT_EQ(host::returnAddressOf(nullptr, 0), 0u);
}

/* ---- The whole kernel ------------------------------------------------------------------------ */

const zel_UUID self = *host::parseUUID("aaaaaaaa-0000-0000-0000-000000000001");
const zel_UUID interfaceUUID = *host::parseUUID("bbbbbbbb-0000-0000-0000-000000000001");

/* This host's node with one healthy interface. */
void describeSelf(host::Directory &directory) {
  KarstNetInterfaceEntry interface {};
  interface.networkType = KARST_NETWORK_TYPE_IP;
  interface.numIpAddresses = 1;
  interface.ipAddresses[0].address[0] = 10;
  interface.ipAddresses[0].address[3] = 9;
  directory.setSelf(self);
  directory.put({KARST_TYPE_NODE, self, self, host::encode(KarstNodeEntry{})});
  directory.put({KARST_TYPE_NET_INTERFACE, interfaceUUID, self, host::encode(interface)});
  directory.put(
      {KARST_TYPE_HEALTH_STATUS, interfaceUUID, self, host::encode(KarstHealthStatusEntry{})});
  directory.setUsable(true);
}

TEST(Kernel, LeavesNothingOfTheResolverBehind) {
  LogLines log;
  host::Kernel kernel;
  EXPECT_THAT(kernel.alive(), IsEmpty());
  for (int round = 0; round < 10; round++) {
    host::Module &resolver = kernel.modules().load(TEST_RESOLVER);
    describeSelf(kernel.directory());
    kernel.settle();
    EXPECT_THAT(kernel.alive(),
                testing::IsSupersetOf({HasSubstr("module karst_resolver.so"),
                                       HasSubstr("heap KARSTResolver: "), HasSubstr("log ")}));
    kernel.modules().unload(resolver);
    ASSERT_THAT(kernel.alive(), IsEmpty());
    kernel.directory().setUsable(false);
  }
  EXPECT_THAT(log.texts(), IsEmpty());
}

TEST(Kernel, SettlesWhenTheResolverHasTakenInTheDirectory) {
  host::Kernel kernel;
  const host::Module &resolver = kernel.modules().load(TEST_RESOLVER);
  describeSelf(kernel.directory());
  kernel.settle();
  KARSTResolverInstance *instance = nullptr;
  ASSERT_EQ(resolver.function<decltype(KARSTResolver_Create)>("KARSTResolver_Create")(
                &instance, 0, zel_UUID{}, self, false),
            ZEL_OK);
  KARSTResolverNodeLocators locators{};
  locators.capacity = KARST_RESOLVER_MAX_LOCATORS;
  EXPECT_EQ(resolver.function<decltype(KARSTResolver_GetNodeLocators)>(
                "KARSTResolver_GetNodeLocators")(instance, &locators),
            ZEL_OK);
  ASSERT_EQ(locators.count, 1);
  EXPECT_EQ(locators.locators[0].networkType, KARST_RESOLVER_LOCATOR_IPV4);
  EXPECT_EQ(locators.locators[0].address[3], 9);
  resolver.function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy")(instance);
}

TEST(Kernel, RunsTheExampleClientAndFollowsChanges) {
  LogLines log;
  {
    host::Kernel kernel;
    kernel.modules().load(TEST_RESOLVER);
    describeSelf(kernel.directory());
    kernel.settle();
    kernel.modules().load(TEST_CLIENT, {"CLIENT_USE_LOCAL_LOCATOR=0"});
    kernel.settle();
    kernel.directory().remove(KARST_TYPE_HEALTH_STATUS, interfaceUUID);
    kernel.settle();
  }
  const auto texts = log.texts();
  ASSERT_THAT(texts, testing::Contains("client: 1 locators, the first of type 1"));
  EXPECT_EQ(texts.front(), "client: this host's node is resolved");
  EXPECT_THAT(texts, testing::Contains("client: this host's node is unresolved"));
  EXPECT_EQ(texts.back(), "client: no locators: ZEL_NOT_FOUND");
}

TEST(Kernel, RefusesTheClientWithoutTheResolverByName) {
  host::Kernel kernel;
  try {
    kernel.modules().load(TEST_CLIENT);
    FAIL() << "it was loaded";
  } catch (const host::ModuleError &error) {
    EXPECT_THAT(error.what(), AllOf(HasSubstr("com.tarvik.karst.resolver#0.0.0.1"),
                                    HasSubstr("com.tarvik.zelapi#v2_4_0_0")));
  }
}

TEST(Kernel, SaysWhatThisHostIs) {
  host::KernelSettings settings;
  settings.maxAssociations = 4321;
  settings.witness = true;
  host::Kernel kernel(settings);
  kernel.directory().setSelf(self);
  EXPECT_EQ(QXT_GetMaxAssocCount(), 4321u);
  EXPECT_TRUE(TOLM_IsWitnessNode());
  zel_UUID uuid{};
  KARST_GetSelfUUID(&uuid);
  EXPECT_EQ(uuid, self);
}

TEST(Kernel, RefusesLookupsThatItDoesNotServe) {
  host::Kernel kernel;
  KarstQuery query{};
  query.type = KARST_TYPE_NODE;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL;
  KarstEntryHeader header{};
  KarstFullEntry *entry = nullptr;
  const ExprMshAllocator none{};
  EXPECT_EQ(KARST_FindEntry(&query, 0, &header, 63), ZEL_BAD_PARAM);
  EXPECT_EQ(KARST_FindEntry(&query, 2, &header, 64), ZEL_BAD_PARAM);
  EXPECT_EQ(KARST_FindEntry(&query, 0, &header, 64), ZEL_NOT_FOUND);
  EXPECT_EQ(KARST_FindFullEntryByQuery(&query, 1, &none, &entry), ZEL_BAD_PARAM);
  EXPECT_EQ(KARST_FindFullEntryByHeader(&header, 0, &none, 0, &entry), ZEL_BAD_PARAM);
}

TEST(KernelDeathTest, IsOneAtATimeAndNeeded) {
  EXPECT_DEATH(QXT_GetMaxAssocCount(), "without a host kernel");
  EXPECT_DEATH(
      {
        host::Kernel first;
        host::Kernel second;
      },
      "has a host kernel already");
}

TEST(KernelDeathTest, EndsFatallyWithThingsLeftBehind) {
  EXPECT_DEATH(
      {
        host::Kernel kernel;
        zel_Log *log = nullptr;
        Tolm_LogInit("forgotten", 1, 2, 0, &log);
      },
      "left behind: log forgotten(.*\n)*panic: 1 things were left behind");
}

}  // namespace
