/* Loading and unloading; the module's memory. */
#include "platform/tolm.h"
#include "tests/module_fixture.h"

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace {

class Load : public ModuleTest {
 public:
  explicit Load(const sim::Settings &settings = defaults()) : ModuleTest(settings) {}
  void TestBody() override {}
  using ModuleTest::load, ModuleTest::sim;

 protected:
  zel_HeapID heap() { return host::heapsAlive().at(0); }
};

TEST_F(Load, BuildsInOrderAndUnloadsInReverse) {
  const std::vector<std::string> life = {"Tolm_LogInit",
                                         "zel_HeapCreate",
                                         "zel_LockDomainCreate",
                                         "zel_SpinlockCreate",
                                         "KARST_RegisterStatusCallback",
                                         "KARST_DeregisterStatusCallback",
                                         "zel_SpinlockDestroy",
                                         "zel_LockDomainDestroy",
                                         "zel_HeapDestroy",
                                         "Tolm_LogCleanup"};
  ASSERT_EQ(load(), "");
  EXPECT_EQ(sim.uses(sim::Call::TokenBucket_InitMini), 19u);
  unload();
  EXPECT_EQ(calls(life), life);
  EXPECT_THAT(sim.alive(), IsEmpty());
}

TEST_F(Load, FailsWithTheStatusOfWhatFailed) {
  sim.failAt(sim::Call::zel_SpinlockCreate, 1, 1, 0x0bad0999);
  EXPECT_NE(load(), "");
  EXPECT_THAT(log, ElementsAre(HasSubstr("Failed to create spinlock: unknown status")));
}

/* One instance and its lock for each association and 5 MiB, in 32 bits; at least the parameter. */
TEST(HeapSize, IsComputedOrTheParameterWhicheverIsMore) {
  const std::string least = "KARST_RESOLVER_LEAST_MAX_HEAP=";
  const struct {
    uint32_t associations;
    std::vector<std::string> parameters;
    uint32_t expected, perAssociation;
  } rows[] = {
      {0, {}, 0xa00000, 0},
      {0, {least + "0xa00001"}, 0xa00001, 0},
      {0, {least + "-1"}, 0xffffffff, 0}, /* a very large unsigned size */
      {0, {least + "5242880"}, 0x500000, 0},
      {40000, {least + "1"}, 0x500000, 40000},
      {0x80000000, {}, 0xa00000, 0}, /* times an even number: nothing, in 32 bits */
  };
  for (const auto &row : rows) {
    sim::Settings settings;
    settings.maxAssociations = row.associations;
    Load module(settings);
    ASSERT_EQ(module.load(row.parameters), "");
    const uint32_t size = module.sim.call("reader", [] {
      return tolmapi_HeapRequest2Size(392) + zel_SpinlockAllocSize(ZEL_SPINLOCK_RANKED);
    });
    EXPECT_EQ(host::heapState(host::heapsAlive().at(0)).maximum,
              row.expected + row.perAssociation * size)
        << row.associations << " associations, " << ::testing::PrintToString(row.parameters);
  }
}

/* ---- Memory ---------------------------------------------------------------------------------- */

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

TEST_F(Load, BlocksAreZeroedAndNameTheirCallers) {
  ASSERT_EQ(load(), "");
  std::vector<std::string> askers;
  for (const host::HeapBlock &block : host::heapState(heap()).blocks) {
    const std::string symbol = host::symbolize(block.returnAddress);
    askers.push_back(symbol.substr(0, symbol.find("+0x")));
  }
  EXPECT_THAT(askers, ::testing::IsSupersetOf({std::string("KARSTResolverCacheInit"),
                                               std::string("KARSTRBTree_CreateTreeData")}));
  const EntryPoints from{
      internal<void *(uint32_t)>("KARSTResolverAlloc"),
      static_cast<const KARSTMemPool *>(module().anySymbol("karstResolverMemPool")),
      static_cast<const ExprMshAllocator *>(module().anySymbol("resolverMshAlloc")),
  };
  EXPECT_EQ(from.pool->base, 0u) << "links are plain addresses";
  std::array<void *, 6> blocks;
  for (void *&block : blocks) { /* these leave their dirt behind */
    block = host::heapAlloc(heap(), 8, nullptr);
    std::memset(block, 0xee, 8);
  }
  for (void *block : blocks) host::heapFree(heap(), block);
  sim.call("caller", [&] { askForBlocks(from, blocks.data()); });

  const auto recorded = host::heapState(heap()).blocks;
  ASSERT_EQ(recorded.size(), askers.size() + blocks.size());
  auto *previous = reinterpret_cast<uint8_t *>(&askForBlocks);
  for (size_t i = 0; i < blocks.size(); i++) {
    const host::HeapBlock &block = recorded[askers.size() + i];
    EXPECT_EQ(block.address, blocks[i]);
    EXPECT_EQ(block.size, 8u);
    EXPECT_EQ(*static_cast<uint64_t *>(block.address), 0u) << i;
    auto *address = static_cast<uint8_t *>(block.returnAddress);
    EXPECT_GT(address, previous) << "behind the call before, in the function that called";
    EXPECT_LT(address, previous + 512);
    previous = address;
  }
  sim.call("caller", [&] {
    EXPECT_EQ(from.pool->calloc(nullptr, 0x10000, 0x10000), nullptr) << "does not fit in 32 bits";
    for (void *block : blocks) from.msh->free(nullptr, block);
    const uint64_t frees = sim.uses(sim::Call::zel_HeapFree);
    from.msh->free(nullptr, nullptr);
    EXPECT_EQ(sim.uses(sim::Call::zel_HeapFree), frees) << "nothing is nothing to free";
  });
  EXPECT_DEATH(sim.call("caller", [&] { from.pool->realloc(nullptr, nullptr, 1); }),
               "Failed at karst_resolver/karst_resolver_util:[0-9]+ -- NOT REACHED");
}

}  // namespace
