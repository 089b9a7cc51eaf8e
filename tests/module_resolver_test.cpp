/* What a client sees, value by value: why a create fails, every byte of a read-out, callbacks; and
 * the module's lines that no failure makes. */
#include <cstring>

#include "tests/module_fixture.h"

using ::testing::ElementsAre;
using ::testing::SizeIs;

namespace {

constexpr uint32_t RESOLVED = KARST_RESOLVER_STATE_RESOLVED;
constexpr uint32_t UNRESOLVED = KARST_RESOLVER_STATE_UNRESOLVED;

class Resolver : public ModuleTest {
 protected:
  void SetUp() override {
    for (uint32_t n = 1; n <= 3; n++) putSimpleNode(n);
    putObject(1, 2);
    start();
  }
};

TEST_F(Resolver, ReportsOwnersThatChangedMeanwhileAndUnknownNetworks) {
  const std::string owner =
      "2 KARSTResolver: KARSTResolverUpdateNetIf:N: Netif owner changed to "
      "a0000000-0000-0000-0000-000000000003";
  const std::string unknown =
      "1 KARSTResolver: KARSTResolverGenerateNodeLocators:N: Unknown network type 7 for interface "
      "b0000000-0000-0000-0000-000000000009";
  sim.hold("karst-delivery"); /* the entry moves on before its first event is looked at */
  putNetIf(4, 2, {"10.0.0.4"});
  putNetIf(4, 3, {"10.0.0.4"});
  sim.release("karst-delivery");
  sim.run();
  putHealth(9, 0);
  putNetIf(9, 2, {"10.0.0.9"}, 0, 7);
  sim.run();
  EXPECT_THAT(log, ElementsAre(owner, unknown));
}

TEST_F(Resolver, CreateSaysWhyItFails) {
  Client client;
  const auto withoutResult = [&] { return create_(nullptr, 0, noUUID, nodeUUID(1), false); };
  EXPECT_EQ(sim.call("client", withoutResult), ZEL_BAD_PARAM);
  EXPECT_EQ(create(client, noUUID, noUUID), ZEL_BAD_PARAM);
  EXPECT_EQ(create(client, noUUID, nodeUUID(9)), ZEL_NOT_FOUND);

  /* While init_module still runs, another module's thread may come early. */
  auto **cachePointer = internal<KARSTResolverCache *>("karstResolverCache");
  KARSTResolverCache *kept = std::exchange(*cachePointer, nullptr);
  EXPECT_EQ(create(client, noUUID, nodeUUID(1)), ZEL_NOT_INITIALIZED);
  *cachePointer = kept;
  EXPECT_EQ(client.instance, nullptr);
}

TEST_F(Resolver, ReadOutWritesWhatItSaysAndNothingElse) {
  Client client;
  ASSERT_EQ(create(client, noUUID, nodeUUID(2)), ZEL_OK);
  std::vector<uint8_t> bytes, before;
  const auto readWith = [&](uint16_t capacity) {
    before.assign(KARSTResolverNodeLocatorsSize(9) + 8, 0xee);
    std::memcpy(&before[offsetof(KARSTResolverNodeLocators, capacity)], &capacity, sizeof capacity);
    bytes = before;
    return read(client, reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data()));
  };
  const auto *own = reinterpret_cast<const uint8_t *>(&client.instance->locators);
  const auto checkWith = [&](uint16_t capacity, uint16_t count) {
    SCOPED_TRACE(std::to_string(count) + " of " + std::to_string(capacity));
    ASSERT_EQ(readWith(capacity), ZEL_OK);
    const auto &set = *reinterpret_cast<KARSTResolverNodeLocators *>(bytes.data());
    EXPECT_EQ(set.capacity, capacity);
    EXPECT_EQ(set.count, count);
    const auto first = static_cast<long>(KARSTResolverNodeLocatorsSize(0)),
               end = static_cast<long>(KARSTResolverNodeLocatorsSize(count));
    EXPECT_TRUE(std::equal(&bytes[first], &bytes[end], own + first));
    EXPECT_TRUE(std::equal(bytes.begin() + end, bytes.end(), before.begin() + end));
  };
  putNetIf(2, 2, {"10.0.0.2", "fd00::2", "10.0.0.22"});
  sim.run();
  for (const uint16_t capacity : {0, 2, 9}) checkWith(capacity, std::min<uint16_t>(capacity, 3));
  putNetIf(2, 2, {"10.0.0.2", "fd00::2", "10.0.0.22", "fd00::22"});
  sim.run();
  for (const uint16_t capacity : {3, 4, 9}) checkWith(capacity, std::min<uint16_t>(capacity, 4));
  putHealth(2, 1);
  sim.run();
  EXPECT_EQ(readWith(4), ZEL_NOT_FOUND);
  EXPECT_EQ(bytes, before);
  destroy(client);
}

TEST_F(Resolver, CallbackComesAtOnceAndAtEveryRefresh) {
  Client client;
  ASSERT_EQ(create(client, objectUUID(1), noUUID), ZEL_OK);
  setCallback(client);
  for (const uint32_t health : {1, 0}) {
    putHealth(2, health);
    sim.run();
  }
  putNetIf(2, 2, {"10.0.0.2"}, 0x5); /* another record, the same answer */
  sim.run();
  EXPECT_THAT(client.states, ElementsAre(RESOLVED, UNRESOLVED, RESOLVED, RESOLVED));
  setCallback(client, false);
  putHealth(2, 1);
  sim.run();

  traced();
  sim.hold("karst-delivery"); /* the subscription's last call is due, and keeps the instance */
  KARSTResolverInstance *instance = client.instance;
  destroy(client);
  using Told = zel_Status(void *, const KarstEntryHeader *, void *, zel_Status);
  KarstEntryHeader header{};
  header.owner = nodeUUID(2);
  sim.call("directory", [&] {
    internal<Told>("KARSTResolverObjectSubCbk")(instance, &header, nullptr, ZEL_OK);
    /* Another one had looked before the destroy. */
    internal<void(KARSTResolverInstance *, zel_UUID)>("KARSTResolverTrackNode")(instance,
                                                                                nodeUUID(2));
  });
  client.instance = instance;
  setCallback(client);
  sim.release("karst-delivery");
  sim.run();
  EXPECT_THAT(traced(), SizeIs(3)) << "destroyed, and released twice";
  EXPECT_EQ(client.states.size(), 4u);
}

}  // namespace
