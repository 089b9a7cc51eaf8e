/* The comparison of a cache with the directory sees whatever is wrong. */
#include "tests/directory_view.h"

#include "tests/module_fixture.h"

using ::testing::HasSubstr;

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

  std::string differences() {
    const std::vector<HeldInstance> held = {{client_.instance, client_.states.back()}};
    std::string text;
    for (const std::string &line :
         differencesOf(cache(), viewOf(directory(), nodeUUID(1), false, held)))
      text += line + "\n";
    return text;
  }

  /* What is said while one bit of the field is another. */
  template <typename Field>
  std::string without(Field *field, uint8_t bit = 1) {
    auto *byte = reinterpret_cast<uint8_t *>(field);
    *byte ^= bit;
    const std::string text = differences();
    *byte ^= bit;
    return text;
  }

  Client client_;
};

TEST_F(View, SeesEveryFieldThatIsWrong) {
  EXPECT_EQ(differences(), "");
  KARSTResolverNode *node = cachedNode(2);
  KARSTResolverNetIf *netIf = cachedNetIfs().at(1);
  KARSTResolverInstance *instance = client_.instance;
  const std::pair<std::string, const char *> rows[] = {
      {without(&cache()->enabled), "cache: enabled 0"},
      {without(&cache()->refCount), "cache: enabled 1, references 9, self"},
      {without(&cache()->selfUUID), "self a1000000-0000-0000-0000-000000000001; not"},
      {without(&cache()->tag), "cache: its tag"},
      {without(&cache()->nodeTree->data->count), "node tree"},
      {without(&node->tag), "karstrn"},
      {without(&node->refCount, 8), ": references 11, interfaces 1, instances 1"},
      {without(&node->uuid.bytes[15]), "node tree"},
      {without(reinterpret_cast<uint8_t *>(&node->treeElem.word) + 3, 0x40), "node tree"},
      {without(&node->isSelf), "self 1, witness 0"},
      {without(&node->isWitness), "self 0, witness 1"},
      {without(&node->rescanSeen), "mark of a rescan 1, room"},
      {without(&node->reachable), "reachable 0"},
      {without(&node->majorVersion), "version 6.1, a0000000"},
      {without(&node->minorVersion), "version 7.0, a0000000"},
      {without(&node->locators.count), "traffic 0,; not references 3"},
      {without(&node->locators.locators[0].address[3]), "traffic 0, 1:0a000003; not"},
      {without(&node->locators.capacity), "room for 5 locators"},
      {without(&netIf->tag), "karstrni"},
      {without(&netIf->refCount), ": references 3, record"},
      {without(&netIf->healthSubInstalled), "health subscription 0"},
      {without(&netIf->healthy), "healthy 0"},
      {without(&netIf->rescanSeen), "mark of a rescan 1; not"},
      {without(&netIf->info.bandwidth), "interface b0000000-0000-0000-0000-000000000002 of a0000"},
      {without(&netIf->health.timestamp), "interface b0000000-0000-0000-0000-000000000002 of a000"},
      {without(&cache()->nodePool[127].uuid), "127 is neither in use nor free"},
      {without(&cache()->netIfPool[511].tag), "511 is neither in use nor free"},
      {without(&instance->refCount), "object:c0000000-0000-0000-0000-000000000001: references 3"},
      {without(&instance->state, 3), "state 2, callback was told 1"},
      {without(&instance->destroyed), "destroyed 1"},
      {without(&instance->locators.majorVersion),
       "a0000000-0000-0000-0000-000000000002, version 6"},
      {without(&client_.states.back()), "callback was told 0"},
  };
  for (const auto &[text, expected] : rows) EXPECT_THAT(text, HasSubstr(expected));
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
      EXPECT_NE(differences(), "");
      *head = before;
    }
  }
  EXPECT_EQ(differences(), "");
}

/* What the module has not been told of yet. */
TEST_F(View, SeesWhatIsMissingAndWhatIsTooMuch) {
  directory().remove(KARST_TYPE_NODE, nodeUUID(3));
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(4));
  putNode(6);
  putNetIf(7, 5, {"10.0.0.7"});
  putHealth(2, 1);
  putNode(5, 9);
  const std::string text = differences();
  for (const char *line : {"node a0000000-0000-0000-0000-000000000003: references 2, interfaces 1, "
                           "instances 0, reachable 1",
                           "interface b0000000-0000-0000-0000-000000000004 of a0000000-0000-0000-"
                           "0000-000000000004: should not be cached",
                           "node a0000000-0000-0000-0000-000000000006: missing; not references 1",
                           "000000000007 of a0000000-0000-0000-0000-000000000005: missing",
                           "healthy 1, health subscription 1, mark of a rescan 0; not",
                           "state 1, callback was told 1, a0000000-0000-0000-0000-000000000002",
                           "version 7.1, a0000000-0000-0000-0000-000000000005"}) {
    EXPECT_THAT(text, HasSubstr(line));
  }
  sim.run();
  putHealth(5, 1); /* brings the version to the locators */
  sim.run();
  EXPECT_EQ(differences(), "");
}

}  // namespace
