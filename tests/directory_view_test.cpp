/* The comparison of a cache with the directory sees whatever is wrong. */
#include "tests/directory_view.h"

#include <functional>

#include "tests/module_fixture.h"

using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;

namespace {

class View : public ModuleTest {
 protected:
  void SetUp() override {
    for (uint32_t number = 1; number <= 5; number++) putSimpleNode(number);
    putObject(1, 2);
    start();
    ASSERT_EQ(createForObject(client_, 1), ZEL_OK);
    setCallback(client_);
  }
  void TearDown() override { destroy(client_); }

  std::vector<std::string> differences() {
    const std::vector<HeldInstance> held = {{client_.instance, client_.states.back()}};
    return differencesOf(cache(), viewOf(directory(), nodeUUID(1), false, held));
  }
  std::string text() {
    std::string lines;
    for (const std::string &line : differences()) lines += line + "\n";
    return lines;
  }

  /* The text while one bit of the field is another. */
  template <typename Field>
  std::string textWithout(Field *field, uint8_t bit = 1) {
    auto *byte = reinterpret_cast<uint8_t *>(field);
    *byte ^= bit;
    const std::string lines = text();
    *byte ^= bit;
    return lines;
  }

  Client client_;
};

TEST_F(View, SeesEveryFieldThatIsWrong) {
  EXPECT_THAT(differences(), IsEmpty());
  KARSTResolverNode *node = cachedNode(2);
  KARSTResolverNetIf *netIf = cachedNetIfs().at(1);
  KARSTResolverInstance *instance = client_.instance;
  const std::pair<std::string, const char *> rows[] = {
      {textWithout(&cache()->enabled), "cache: enabled"},
      {textWithout(&cache()->refCount), "cache: references"},
      {textWithout(&cache()->selfUUID), "cache: another self"},
      {textWithout(&cache()->tag), "cache: its tag"},
      {textWithout(&cache()->nodeTree->data->count), "node tree"},
      {textWithout(&node->tag), "karstrn"},
      {textWithout(&node->refCount, 8), "11 references, not 3"},
      {textWithout(&node->uuid.bytes[15]), "node tree"},
      {textWithout(reinterpret_cast<uint8_t *>(&node->treeElem.word) + 3, 0x40), "node tree"},
      {textWithout(&node->isSelf), "is self"},
      {textWithout(&node->isWitness), "witness"},
      {textWithout(&node->rescanSeen), "seen by a rescan"},
      {textWithout(&node->reachable), "references"},
      {textWithout(&node->majorVersion), "major version"},
      {textWithout(&node->minorVersion), "minor version"},
      {textWithout(&node->locators.count), "traffic 0,; not version 7.1, traffic 0, 1:0a000002"},
      {textWithout(&node->locators.locators[0].address[3]),
       "1:0a000003000000000000000000000000; not"},
      {textWithout(&node->locators.capacity), "capacity"},
      {textWithout(&netIf->tag), "karstrni"},
      {textWithout(&netIf->refCount), "references"},
      {textWithout(&netIf->healthSubInstalled), "references"},
      {textWithout(&netIf->healthy), "healthy"},
      {textWithout(&netIf->rescanSeen), "seen by a rescan"},
      {textWithout(&netIf->info.bandwidth), "other record"},
      {textWithout(&netIf->health.timestamp), "other health record"},
      {textWithout(&cache()->nodePool[127].uuid), "is not empty"},
      {textWithout(&cache()->netIfPool[511].tag), "is not empty"},
      {textWithout(&instance->refCount), "object:c0000000-0000-0000-0000-000000000001: references"},
      {textWithout(&instance->state, 3), "state"},
      {textWithout(&instance->destroyed), "destroyed"},
      {textWithout(&instance->locators.majorVersion),
       "object:c0000000-0000-0000-0000-000000000001: version 6"},
      {textWithout(&client_.states.back()), "callback was told"},
  };
  for (const auto &[lines, expected] : rows) EXPECT_THAT(lines, HasSubstr(expected));
}

TEST_F(View, SeesBrokenLists) {
  KARSTResolverNode *node = cachedNode(2);
  for (KARSTResolverLink *head : {&cache()->freeNodes, &cache()->freeNetIfs, &cache()->netIfs,
                                  &node->netIfList, &node->instanceList}) {
    const KARSTResolverLink before = *head;
    for (const KARSTResolverLink &broken :
         {KARSTResolverLink{nullptr, nullptr}, KARSTResolverLink{head, head},
          KARSTResolverLink{before.previous, before.next->next},
          KARSTResolverLink{before.previous->previous, before.next}}) {
      *head = broken;
      EXPECT_THAT(damageOf(cache()), Not(IsEmpty()));
      *head = before;
    }
  }
  EXPECT_THAT(damageOf(cache()), IsEmpty());
}

/* What the module has not been told of yet. */
TEST_F(View, SeesWhatIsMissingAndWhatIsTooMuch) {
  directory().remove(KARST_TYPE_NODE, nodeUUID(3));
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(4));
  putNode(6);
  putNetIf(7, 5, {"10.0.0.7"});
  putHealth(2, 1);
  putNode(5, 9);
  const std::string lines = text();
  for (const char *line : {"node a0000000-0000-0000-0000-000000000003: reachable 1, not 0",
                           "interface b0000000-0000-0000-0000-000000000004: should not be cached",
                           "node a0000000-0000-0000-0000-000000000006: missing",
                           "interface b0000000-0000-0000-0000-000000000007: missing",
                           "interface b0000000-0000-0000-0000-000000000002: healthy 1, not 0",
                           "object:c0000000-0000-0000-0000-000000000001: state 1, not 2",
                           "node a0000000-0000-0000-0000-000000000005: major version 7, not 9"}) {
    EXPECT_THAT(lines, HasSubstr(line));
  }
  sim.run();
  putHealth(5, 1); /* brings the version to the locators */
  sim.run();
  EXPECT_THAT(differences(), IsEmpty());
}

}  // namespace
