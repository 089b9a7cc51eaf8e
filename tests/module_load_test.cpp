/* Loading and unloading; the module's memory. */
#include "platform/tolm.h"
#include "tests/module_fixture.h"

using sim::Call;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace {

class Load : public ModuleTest {};

TEST_F(Load, BuildsInOrderAndUnloadsInReverse) {
  const auto life = {Call::Tolm_LogInit,
                     Call::zel_HeapCreate,
                     Call::zel_LockDomainCreate,
                     Call::zel_SpinlockCreate,
                     Call::KARST_RegisterStatusCallback,
                     Call::KARST_DeregisterStatusCallback,
                     Call::zel_SpinlockDestroy,
                     Call::zel_LockDomainDestroy,
                     Call::zel_HeapDestroy,
                     Call::Tolm_LogCleanup};
  ASSERT_EQ(load(), "");
  EXPECT_EQ(sim.uses(Call::TokenBucket_InitMini), 19u);
  unload();
  EXPECT_THAT(calls(life),
              ElementsAre("Tolm_LogInit", "zel_HeapCreate", "zel_LockDomainCreate",
                          "zel_SpinlockCreate", "KARST_RegisterStatusCallback",
                          "KARST_DeregisterStatusCallback", "zel_SpinlockDestroy",
                          "zel_LockDomainDestroy", "zel_HeapDestroy", "Tolm_LogCleanup"));
  EXPECT_THAT(sim.alive(), IsEmpty());
}

TEST_F(Load, SpinlockFailureKeepsItsStatus) {
  sim.failAt(Call::zel_SpinlockCreate, 1, 1, 0x0bad0999);
  EXPECT_NE(load(), "");
  EXPECT_THAT(log, ElementsAre(HasSubstr("Failed to create spinlock: unknown status")));
}

/* ---- The heap's maximum size ----------------------------------------------------------------- */

uint32_t heapMaximum() {
  return host::heapState(host::heapsAlive().at(0)).maximum;
}

class HeapSize : public ModuleTest {
 protected:
  static sim::Settings associations(uint32_t count) {
    sim::Settings settings = defaults();
    settings.maxAssociations = count;
    return settings;
  }
  explicit HeapSize(uint32_t count) : ModuleTest(associations(count)) {}
  static uint32_t perAssociation() {
    return tolmapi_HeapRequest2Size(392) + zel_SpinlockAllocSize(1);
  }
};
struct HeapSizeNone : HeapSize {
  HeapSizeNone() : HeapSize(0) {}
};
struct HeapSizeMany : HeapSize {
  HeapSizeMany() : HeapSize(40000) {}
};
struct HeapSizeWrapping : HeapSize {
  HeapSizeWrapping() : HeapSize(0x80000000) {}
};

TEST_F(HeapSizeNone, DefaultParameterWins) {
  ASSERT_EQ(load(), "");
  EXPECT_EQ(heapMaximum(), 0xa00000u);
}

TEST_F(HeapSizeNone, AnyLargerParameterWins) {
  ASSERT_EQ(load({"KARST_RESOLVER_LEAST_MAX_HEAP=0xa00001"}), "");
  EXPECT_EQ(heapMaximum(), 0xa00001u);
  unload();
  ASSERT_EQ(load({"KARST_RESOLVER_LEAST_MAX_HEAP=-1"}), "") << "a very large unsigned size";
  EXPECT_EQ(heapMaximum(), 0xffffffffu);
  unload();
  ASSERT_EQ(load({"KARST_RESOLVER_LEAST_MAX_HEAP=5242880"}), "") << "a tie";
  EXPECT_EQ(heapMaximum(), 0x500000u);
}

TEST_F(HeapSizeMany, RoomForEachAssociation) {
  ASSERT_EQ(load({"KARST_RESOLVER_LEAST_MAX_HEAP=1"}), "");
  EXPECT_EQ(heapMaximum(), sim.call("reader", [] { return 40000 * perAssociation(); }) + 0x500000);
}

TEST_F(HeapSizeWrapping, ThirtyTwoBits) {
  ASSERT_EQ(load(), "");
  uint32_t product = 0x80000000u * sim.call("reader", [] { return perAssociation(); });
  EXPECT_EQ(heapMaximum(), std::max<uint32_t>(product + 0x500000, 0xa00000));
}

/* ---- Memory ---------------------------------------------------------------------------------- */

class Memory : public ModuleTest {
 protected:
  void SetUp() override { ASSERT_EQ(load(), ""); }
  zel_HeapID heap() { return host::heapsAlive().at(0); }
};

/* The block stands where a dirty one was. */
void *dirtied(zel_HeapID heap, uint32_t size) {
  void *block = host::heapAlloc(heap, size, nullptr);
  std::memset(block, 0xee, size);
  host::heapFree(heap, block);
  return block;
}

TEST_F(Memory, BlocksAreZeroedOverWhatWasAskedFor) {
  auto *alloc = internal<void *(uint32_t)>("KARSTResolverAlloc");
  auto *release = internal<void(void *)>("KARSTResolverFree");
  dirtied(heap(), 32);
  auto *block = static_cast<uint8_t *>(sim.call("caller", [&] { return alloc(7); }));
  for (int i = 0; i < 7; i++) EXPECT_EQ(block[i], 0) << i;
  sim.call("caller", [&] { release(block); });
}

struct EntryPoints {
  void *(*alloc)(uint32_t);
  const KARSTMemPool *pool;
  const ExprMshAllocator *msh;
};

/* Two calls of one entry point, and one of each other; nothing else in here. */
__attribute__((noinline)) void askForBlocks(const EntryPoints &from, void **blocks) {
  blocks[0] = from.alloc(8);
  blocks[1] = from.alloc(8);
  blocks[2] = from.pool->alloc(nullptr, 0x100000008);
  blocks[3] = from.pool->calloc(nullptr, 2, 4);
  blocks[4] = from.msh->alloc(nullptr, 8);
  blocks[5] = from.msh->zeroedAlloc(nullptr, 8);
}

TEST_F(Memory, RecordsTheCallerNotItself) {
  EntryPoints from{
      internal<void *(uint32_t)>("KARSTResolverAlloc"),
      static_cast<const KARSTMemPool *>(module().anySymbol("karstResolverMemPool")),
      static_cast<const ExprMshAllocator *>(module().anySymbol("resolverMshAlloc")),
  };
  size_t before = host::heapState(heap()).blocks.size();
  std::array<void *, 6> blocks;
  sim.call("caller", [&] { askForBlocks(from, blocks.data()); });
  auto recorded = host::heapState(heap()).blocks;
  recorded.erase(recorded.begin(), recorded.begin() + static_cast<long>(before));
  ASSERT_EQ(recorded.size(), blocks.size());
  auto *previous = reinterpret_cast<uint8_t *>(&askForBlocks);
  for (size_t i = 0; i < blocks.size(); i++) {
    EXPECT_EQ(recorded[i].address, blocks[i]);
    EXPECT_EQ(recorded[i].size, 8u);
    auto *address = static_cast<uint8_t *>(recorded[i].returnAddress);
    EXPECT_GT(address, previous) << "behind the call before, in the function that called";
    EXPECT_LT(address, previous + 512);
    previous = address;
  }
  sim.call("caller", [&] {
    EXPECT_EQ(from.pool->calloc(nullptr, 0x10000, 0x10000), nullptr) << "does not fit in 32 bits";
    for (void *block : blocks) from.msh->free(nullptr, block);
    from.msh->free(nullptr, nullptr); /* nothing */
  });
  EXPECT_EQ(host::heapState(heap()).blocks.size(), before);
}

/* Inside the module: the cache's blocks name the functions that asked. */
TEST_F(Memory, CachesBlocksNameTheirFunctions) {
  std::vector<std::string> askers;
  for (const host::HeapBlock &block : host::heapState(heap()).blocks) {
    std::string symbol = host::symbolize(block.returnAddress);
    askers.push_back(symbol.substr(0, symbol.find("+0x")));
  }
  EXPECT_THAT(askers, ::testing::IsSupersetOf({std::string("KARSTResolverCacheInit"),
                                               std::string("KARSTRBTree_CreateTreeData")}));
}

TEST_F(Memory, ReallocStopsTheSystem) {
  auto *pool = static_cast<const KARSTMemPool *>(module().anySymbol("karstResolverMemPool"));
  EXPECT_DEATH(sim.call("caller", [&] { pool->realloc(nullptr, nullptr, 1); }),
               "Failed at karst_resolver/karst_resolver_util:[0-9]+ -- NOT REACHED");
}

}  // namespace
