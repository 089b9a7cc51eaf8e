/* Loading, enabling, disabling, unloading: what is called in which order; the module's memory. */
#include <functional>
#include <set>

#include "tests/module_fixture.h"

using ::testing::IsEmpty;
using ::testing::StartsWith;

namespace {

using Load = ModuleTest;

TEST_F(Load, TakesItsStepsInOrder) {
  directory().setSelf(nodeUUID(1));
  putSimpleNode(2);
  const struct {
    std::function<void()> act;
    std::vector<std::string> calls;
  } rows[] = {
      {[&] { load(); },
       {"Tolm_LogInit", "zel_HeapCreate", "zel_LockDomainCreate", "zel_SpinlockCreate",
        "KARST_RegisterStatusCallback"}},
      {[&] {
         directory().setUsable(true);
       }, /* of nodes, of interfaces and, the world's, a health */
       {"KARST_GetSelfUUID", "TOLM_WorldCreate", "KARST_Subscribe", "KARST_Subscribe",
        "KARST_Subscribe"}},
      {[&] { directory().setUsable(false); },
       {"TOLM_WorldDestroy", "KARST_Unsubscribe", "KARST_Unsubscribe", "KARST_Unsubscribe"}},
      {[&] { unload(); },
       {"KARST_DeregisterStatusCallback", "zel_SpinlockDestroy", "zel_LockDomainDestroy",
        "zel_HeapDestroy", "Tolm_LogCleanup"}},
  };
  std::set<std::string> all;
  for (const auto &row : rows) all.insert(row.calls.begin(), row.calls.end());
  for (const auto &row : rows) {
    sim.clearHistory();
    row.act();
    sim.run();
    std::vector<std::string> calls;
    for (const sim::HistoryEntry &entry : sim.history()) {
      const char *const name = sim::traits(entry.call).name;
      if (!entry.note && all.count(name) != 0) calls.emplace_back(name);
    }
    EXPECT_EQ(calls, row.calls);
  }
  EXPECT_EQ(sim.uses(sim::Call::TokenBucket_InitMini), 19u);
  EXPECT_THAT(sim.alive(), IsEmpty());
}

/* Of so many associations that their share is nothing, in 32 bits: 5 MiB; at least the parameter. */
TEST(HeapSize, IsComputedOrTheParameterWhicheverIsMore) {
  const std::string least = "KARST_RESOLVER_LEAST_MAX_HEAP=";
  const std::pair<std::vector<std::string>, uint32_t> rows[] = {
      {{}, 0xa00000},
      {{least + "0xa00001"}, 0xa00001},
      {{least + "-1"}, 0xffffffff}, /* a very large unsigned size */
      {{least + "1"}, 0x500000},
  };
  sim::Settings settings;
  settings.maxAssociations = 0x80000000;
  for (const auto &[parameters, expected] : rows) {
    Bench bench(settings);
    ASSERT_EQ(bench.load(parameters), "");
    EXPECT_EQ(host::heapState(host::heapsAlive().at(0)).maximum, expected);
  }
}

}  // namespace

/* Calls every entry point that gives blocks. A name that the dynamic linker knows. */
extern "C" __attribute__((noinline)) void askForBlocks(void *(*alloc)(uint32_t),
                                                       const KARSTMemPool *pool,
                                                       const ExprMshAllocator *msh) {
  alloc(8);
  pool->alloc(nullptr, 0x100000008);
  pool->calloc(nullptr, 2, 4);
  msh->alloc(nullptr, 8);
  msh->zeroedAlloc(nullptr, 8);
}

namespace {

TEST_F(Load, BlocksNameTheirCallers) {
  ASSERT_EQ(load(), "");
  const zel_HeapID heap = host::heapsAlive().at(0);
  const size_t before = host::heapState(heap).blocks.size();
  const auto *pool = internal<const KARSTMemPool>("karstResolverMemPool");
  const auto *msh = internal<const ExprMshAllocator>("resolverMshAlloc");
  sim.call("caller", [&] {
    askForBlocks(internal<void *(uint32_t)>("KARSTResolverAlloc"), pool, msh);
    EXPECT_EQ(pool->calloc(nullptr, 0x10000, 0x10000), nullptr) << "does not fit in 32 bits";
  });
  const std::vector<host::HeapBlock> blocks = host::heapState(heap).blocks;
  ASSERT_EQ(blocks.size(), before + 5);
  for (size_t i = before; i < blocks.size(); i++) {
    EXPECT_EQ(blocks[i].size, 8u);
    EXPECT_THAT(host::symbolize(blocks[i].returnAddress), StartsWith("askForBlocks"));
    sim.call("caller", [&] { msh->free(nullptr, blocks[i].address); });
  }
  const uint64_t frees = sim.uses(sim::Call::zel_HeapFree);
  sim.call("caller", [&] { msh->free(nullptr, nullptr); });
  EXPECT_EQ(sim.uses(sim::Call::zel_HeapFree), frees) << "nothing is nothing to free";
  EXPECT_EQ(pool->base, 0u) << "links are plain addresses";
  EXPECT_DEATH(sim.call("caller", [&] { pool->realloc(nullptr, nullptr, 1); }),
               "Failed at karst_resolver/karst_resolver_util:[0-9]+ -- NOT REACHED");
}

}  // namespace
