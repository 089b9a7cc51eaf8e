/* The host kernel's own services: UUIDs, text, heaps, log, panic, frames, and what it is as a whole.
 * With modules in it: transcripts/embed.txt. */
#include "host/host_kernel.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include "host/kernel/frames.h"
#include "host/kernel/heap.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "platform/qxt.h"
#include "platform/tolm.h"
#include "tests/log_lines.h"
#include "tests/test_heap.h"

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

/* ---- UUIDs and text -------------------------------------------------------------------------- */

TEST(UUID, IsReadAndPrintedInByteOrder) {
  const zel_UUID uuid{{0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xaa, 0xbb, 0xcc,
                       0xdd, 0xee, 0xff}};
  EXPECT_EQ(host::parseUUID("00112233-4455-6677-8899-aAbBccDdEeFf"), uuid);
  EXPECT_EQ(host::parseUUID("00112233445566778899aabbCcddeeff"), uuid);
  EXPECT_EQ(host::toString(uuid), "00112233-4455-6677-8899-aabbccddeeff");
  for (const char *text :
       {"", "00112233-4455-6677-8899-aabbccddeef", "0011223-34455-6677-8899-aabbccddeeff",
        "00112233-4455-6677-8899-aabbccddeegg", "000112233445566778899aabbccddeeff",
        " 0112233445566778899aabbccddeeff", "00112233+4455-6677-8899-aabbccddeeff"}) {
    EXPECT_EQ(host::parseUUID(text), std::nullopt) << text;
  }
}

TEST(Text, CutsNamesAndZeroesTheRest) {
  zel_Name name;
  zel_NameInitialize(&name, "0123456789012345678901234567890123456789");
  EXPECT_STREQ(name.text, "0123456789012345678901234567890");
  zel_NameInitialize(&name, "abc");
  EXPECT_EQ(std::string(name.text, sizeof name.text), std::string("abc") + std::string(29, '\0'));
}

/* ---- Heaps ----------------------------------------------------------------------------------- */

TEST(Heap, HoldsExactlyWhatTheSizingFunctionSays) {
  for (const uint32_t size : {0u, 17u, 392u}) {
    const uint32_t space = tolmapi_HeapRequest2Size(size);
    TestHeap heap(10 * space);
    std::vector<void *> taken(10);
    for (void *&block : taken) {
      block = heap.get(size);
      ASSERT_NE(block, nullptr);
      EXPECT_EQ(reinterpret_cast<uintptr_t>(block) % 16, 0u);
    }
    EXPECT_EQ(host::heapState(heap.id).used, 10 * space);
    EXPECT_EQ(heap.get(0), nullptr) << "the heap is full";
    heap.put(taken[3]);
    EXPECT_EQ(heap.get(size + 16), nullptr) << "only " << size << " bytes are free";
    EXPECT_EQ(heap.get(0xffffffff), nullptr) << "sizes do not wrap around";
    taken[3] = heap.get(size);
    for (void *block : taken) heap.put(block);
    EXPECT_EQ(host::heapState(heap.id).used, 0u);
    EXPECT_EQ(host::heapState(heap.id).peak, 10 * space);
  }
  EXPECT_EQ(tolmapi_HeapRequest2Size(0xffffffff), 0xffffffff);
  EXPECT_THAT(host::heapsAlive(), IsEmpty());
}

TEST(Heap, ReportsAtItsEndWhatIsAliveAndWhoAskedForIt) {
  LogLines log;
  {
    TestHeap heap(4096);
    const auto asker = reinterpret_cast<char *>(&host::setLogThreshold) + 4;
    heap.get(24, asker);
    heap.get(40, asker);
  }
  EXPECT_THAT(log.texts,
              ElementsAre(HasSubstr("heap test: block of 24 bytes"),
                          HasSubstr("host::setLogThreshold(host::LogThreshold)+0x4"),
                          "heap test: 2 blocks of 64 bytes in total were alive at its end"));
}

TEST(HeapDeathTest, StopsOnBlocksThatAreNotAlive) {
  TestHeap heap(4096);
  TestHeap other(4096);
  auto *const block = reinterpret_cast<char *>(heap.get(32));
  EXPECT_DEATH((heap.put(block), heap.put(block)), "panic: freeing 0x[0-9a-f]+, which is not");
  EXPECT_DEATH(heap.put(block + 16), "is not alive in heap");
  EXPECT_DEATH(other.put(block), "is not alive in heap");
  heap.put(block);
  EXPECT_DEATH((heap.get(16), zel_HeapDestroy(heap.id), heap.get(16)), "there is no heap 0x");
}

/* ---- Log ------------------------------------------------------------------------------------- */

TEST(Log, GoesToStandardErrorAsFarAsLevelAndThresholdAllow) {
  zel_Log *log = nullptr;
  ASSERT_EQ(Tolm_LogInit("Resolver", 3, 2, 0, &log), ZEL_OK);
  testing::internal::CaptureStderr();
  pthread_setname_np(pthread_self(), "scribe");
  zel_LogNoLevel(ZEL_LOG_URGENCY_INFO, "count {} %d\n", 3);
  host::setLogThreshold(host::LogThreshold::Warning);
  host::logInfo("quiet");
  zel_LogLevel(ZEL_LOG_URGENCY_WARNING, log, 2, "%s", "no newline");
  zel_LogLevel(ZEL_LOG_URGENCY_WARNING, log, 3, "above the level\n");
  host::setLogThreshold(host::LogThreshold::Info);
  const std::string stamp = "[0-9]{4}-[0-9]{2}-[0-9]{2} [0-9:]{8}\\.[0-9]{3} ";
  EXPECT_THAT(testing::internal::GetCapturedStderr(),
              testing::MatchesRegex(stamp + "info \\[scribe\\] count \\{\\} 3\n" + stamp +
                                    "warning \\[scribe\\] no newline\n"));
  Tolm_LogCleanup(&log);
  EXPECT_THAT(host::logsOpen(), IsEmpty());
}

/* ---- Panic and frames ------------------------------------------------------------------------ */

TEST(PanicDeathTest, TellsMessageReportAndBacktraceAlsoWhenItsReportFails) {
  host::setPanicReport([] { return std::string("the history"); });
  EXPECT_DEATH(
      zel_PanicWithModuleID(47, "Failed at %s:%d", "file", 12),
      "panic: module 47: Failed at file:12\nthe history\nbacktrace:\n(.*\n)*.*host::panic");
  host::setPanicReport([]() -> std::string { host::panic("second"); });
  EXPECT_DEATH(host::panic("first"), "panic: first\npanic: second\n$");
  host::setPanicReport({});
}

TEST(Frames, EndWhereTheChainLeadsNowhere) {
  struct {
    uintptr_t outer, returnAddress;
  } frames[2] = {};
  frames[0] = {reinterpret_cast<uintptr_t>(&frames[1]), 11};
  frames[1].returnAddress = 22;
  EXPECT_EQ(host::returnAddressOf(&frames[0], 0), 11u);
  EXPECT_EQ(host::returnAddressOf(&frames[0], 1), 22u);
  for (const uintptr_t outer : {uintptr_t{0}, reinterpret_cast<uintptr_t>(&frames[0]) /* circle */,
                                uintptr_t{0x7ffffffffff0} /* not mapped */,
                                reinterpret_cast<uintptr_t>(&frames[1]) + 17 /* not aligned */}) {
    frames[1].outer = outer;
    EXPECT_EQ(host::returnAddressOf(&frames[0], 2), 0u) << outer;
  }
}

/* ---- The whole kernel ------------------------------------------------------------------------ */

__attribute__((noinline)) void expectToKnowTheCaller() {
  EXPECT_EQ(tolmapi_GetReturnAddress(0), reinterpret_cast<uint64_t>(__builtin_return_address(0)));
}

TEST(Kernel, SaysWhatThisHostIsAndWhoCallsAndRefusesLookupsThatAreNotAsAgreed) {
  { host::Kernel earlier; }
  host::KernelSettings settings;
  settings.maxAssociations = 4321;
  settings.witness = true;
  host::Kernel kernel(settings);
  EXPECT_EQ(QXT_GetMaxAssocCount(), 4321u);
  EXPECT_TRUE(TOLM_IsWitnessNode());
  expectToKnowTheCaller();

  KarstQuery query{};
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL;
  KarstEntryHeader header{};
  const ExprMshAllocator allocator{};
  KarstFullEntry *entry = nullptr;
  EXPECT_EQ(KARST_FindEntry(&query, 0, &header, 63), ZEL_BAD_PARAM);
  EXPECT_EQ(KARST_FindFullEntryByQuery(&query, 1, &allocator, &entry), ZEL_BAD_PARAM);
}

TEST(KernelDeathTest, IsOneAtATimeAndNeededAndEndsFatallyWithThingsLeftBehind) {
  EXPECT_DEATH(QXT_GetMaxAssocCount(), "without a host kernel");
  EXPECT_DEATH((host::Kernel{}, host::Kernel{}), "has a host kernel already");
  EXPECT_DEATH(
      {
        host::Kernel kernel;
        zel_Log *log = nullptr;
        Tolm_LogInit("forgotten", 1, 2, 0, &log);
      },
      "left behind: log forgotten(.*\n)*panic: 1 things were left behind");
}

}  // namespace
