/* Every platform call that can fail, failed at each of its uses within each procedure of the
 * module: once, from there on until the host has recovered, and from there on to the end. After
 * each: the documented result and reports, nothing left behind, and the directory's own picture once
 * the host works again. */
#include <algorithm>
#include <functional>
#include <iostream>
#include <tuple>

#include "host/kernel/text.h"
#include "tests/directory_view.h"
#include "tests/module_fixture.h"

using sim::Call;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

class Trial;

/* Something that the module does. */
struct Procedure {
  /* The uses of a call, from the first on, whose failure has another result. */
  struct Failure {
    Call call;
    uint64_t uses;
    const char *result;
  };
  const char *name;
  uint64_t uses;                    /* of calls that can fail: at the least; 0: of none */
  std::function<void(Trial &)> act; /* leaves its result; a failed one is tried again */
  const char *result = "";          /* when nothing fails */
  std::vector<Failure> failures = {};
  void (*prepare)(Trial &) = nullptr; /* else everything is there, and settled */
};

void PrintTo(const Procedure &procedure, std::ostream *out) {
  *out << procedure.name;
}

/* A cluster of two nodes with an interface each and an object on node 2; three clients. */
class Trial : public ModuleTest {
 public:
  explicit Trial(const sim::Settings &settings) : ModuleTest(settings) {
    directory().setSelf(nodeUUID(1));
    putSimpleNode(1);
    putSimpleNode(2);
    putObject(1, 2);
    putObject(2, 2);
  }
  void TestBody() override {}

  static std::vector<Procedure> procedures();
  uint64_t tryOut(const Procedure &procedure, Call call, uint64_t nth, uint64_t count,
                  bool toTheEnd);

 private:
  void settle();
  void loadIt();
  void enable();
  void askFor(const zel_UUID &object, const zel_UUID &node);
  void overflow(const std::function<void(uint32_t)> &change);
  std::vector<std::string> reports() const;
  void recover();
  void leave();

  bool loaded_ = false;
  std::string result_; /* of the procedure, where it has one */
  Client forNode_, forObject_, forSelf_, created_;
  const std::vector<Client *> clients_ = {&forNode_, &forObject_, &forSelf_, &created_};
};

/* ---- The procedures -------------------------------------------------------------------------- */

void Trial::settle() {
  start();
  loaded_ = true;
  ASSERT_EQ(createForNode(forNode_, 2), ZEL_OK);
  ASSERT_EQ(createForObject(forObject_, 1), ZEL_OK);
  ASSERT_EQ(createForNode(forSelf_, 1, true), ZEL_OK);
  for (Client *client : {&forNode_, &forObject_, &forSelf_}) setCallback(*client);
}

void Trial::loadIt() {
  loaded_ = load().empty();
  result_ = loaded_ ? "loaded" : "refused";
}

void Trial::enable() {
  directory().setUsable(false);
  sim.run();
  directory().setUsable(true);
  sim.run();
  result_ = cache()->enabled ? "enabled" : "disabled";
}

void Trial::askFor(const zel_UUID &object, const zel_UUID &node) {
  result_ = host::statusText(create(created_, object, node));
}

/* More changes than a subscription keeps, before it is told of any. */
void Trial::overflow(const std::function<void(uint32_t)> &change) {
  const uint64_t before = directory().overflows();
  sim.hold("karst-delivery");
  for (uint32_t i = 0; i <= sim.settings().queueBound; i++) change(i);
  sim.release("karst-delivery");
  sim.run();
  EXPECT_EQ(directory().overflows(), before + 1);
}

std::vector<Procedure> Trial::procedures() {
  const std::vector<Procedure::Failure> refused = {
      {Call::Tolm_LogInit, 1, "refused"},
      {Call::zel_HeapCreate, 1, "refused"},
      {Call::zel_LockDomainCreate, 1, "refused"},
      {Call::zel_HeapAllocWithRA, 6, "refused"},
      {Call::zel_SpinlockCreate, 1, "refused"},
      {Call::KARST_RegisterStatusCallback, 1, "refused"},
  };
  const std::vector<Procedure::Failure> disabled = {{Call::TOLM_WorldCreate, 1, "disabled"},
                                                    {Call::KARST_Subscribe, 2, "disabled"}};
  const std::vector<Procedure::Failure> noMemory = {
      {Call::zel_HeapAllocWithRA, 1, "ZEL_NO_MEMORY"},
      {Call::zel_SpinlockCreate, 1, "ZEL_NO_MEMORY"},
      {Call::KARST_Subscribe, 1, "ZEL_NO_MEMORY"},
  };
  std::vector<Procedure::Failure> orNotFound = noMemory;
  orNotFound.push_back({Call::KARST_FindEntry, 1, "ZEL_NOT_FOUND"});

  const auto putNetIf2 = [](Trial &t) { t.putNetIf(2, 2, {"10.0.1.2"}); };
  const auto remove = [](Trial &t, uint8_t type, const zel_UUID &uuid) {
    t.directory().remove(type, uuid);
  };
  return {
      {"Load", 11, &Trial::loadIt, "loaded", refused, [](Trial &) {}},
      {"LoadAndEnable", 40, &Trial::loadIt, "loaded", refused,
       [](Trial &t) { t.directory().setUsable(true); }},
      {"Enable", 29, &Trial::enable, "enabled", disabled, [](Trial &t) { t.loadIt(); }},
      {"EnableAgain", 29, &Trial::enable, "enabled", disabled,
       [](Trial &t) { t.settle(), t.directory().setUsable(false); }},

      {"NodeAdded", 3, [](Trial &t) { t.putNode(3); }},
      {"NodeChanged", 6,
       [=](Trial &t) {
         t.putNode(2, 8, 2, KARST_NODE_FLAG_WITNESS);
         t.sim.run();
         putNetIf2(t); /* brings the version to the instances */
       }},
      {"NodesOverflow", 24,
       [=](Trial &t) {
         t.overflow([&](uint32_t i) { t.putNode(2, 8 + i); });
         putNetIf2(t); /* likewise */
       }},
      {"NetIfAdded", 10,
       [](Trial &t) {
         t.putHealth(3, 0);
         t.putNetIf(3, 2, {"10.0.0.3", "fd00::3"});
       }},
      {"NetIfOfUnknownNodeAdded", 5, [](Trial &t) { t.putNetIf(4, 4, {"10.0.0.4"}); }},
      {"NetIfChanged", 3, [=](Trial &t) { putNetIf2(t); }},
      {"NetIfMoved", 10, [](Trial &t) { t.putNetIf(2, 1, {"10.0.0.2"}); }},
      {"NetIfsOverflow", 21,
       [](Trial &t) { t.overflow([&](uint32_t i) { t.putNetIf(2, 2, {"10.0.1.2"}, 1 + i); }); }},
      {"HealthChanged", 3, [](Trial &t) { t.putHealth(2, 3); }},
      {"HealthRemoved", 1, [=](Trial &t) { remove(t, KARST_TYPE_HEALTH_STATUS, netIfUUID(2)); }},
      {"HealthOverflow", 15,
       [](Trial &t) { t.overflow([&](uint32_t i) { t.putHealth(2, 1 + i); }); }},
      {"ObjectRemoved", 1, [=](Trial &t) { remove(t, objectType, objectUUID(1)); }},
      {"ObjectMoved", 1, [](Trial &t) { t.putObject(1, 1); }},
      {"ObjectOverflow", 1,
       [](Trial &t) {
         t.overflow([&](uint32_t i) {
           t.putRaw(objectType, objectUUID(1), nodeUUID(2), {static_cast<uint8_t>(i)});
         });
       }},
      {"Resync", 25, [](Trial &t) { t.directory().resync(); }},

      {"CreateForNode", 2, [](Trial &t) { t.askFor(noUUID, nodeUUID(2)); }, "ZEL_OK", noMemory},
      {"CreateForObject", 4, [](Trial &t) { t.askFor(objectUUID(2), noUUID); }, "ZEL_OK",
       orNotFound},
      {"CreateForObjectWithHint", 4, [](Trial &t) { t.askFor(objectUUID(2), nodeUUID(2)); },
       "ZEL_OK", noMemory},
      {"CreateForUnknownObjectWithHint", 4, [](Trial &t) { t.askFor(objectUUID(3), nodeUUID(2)); },
       "ZEL_OK", noMemory},

      {"NodeRemoved", 0, [=](Trial &t) { remove(t, KARST_TYPE_NODE, nodeUUID(2)); }},
      {"NetIfRemoved", 0, [=](Trial &t) { remove(t, KARST_TYPE_NET_INTERFACE, netIfUUID(2)); }},
      {"SetCallback", 0, [](Trial &t) { t.setCallback(t.forNode_); }},
      {"Destroy", 0, [](Trial &t) { t.destroy(t.forObject_); }},
      {"Disable", 0, [](Trial &t) { t.directory().setUsable(false); }},
      {"Unload", 0, [](Trial &t) { t.leave(); }},
  };
}

/* ---- What must have been reported ------------------------------------------------------------ */

/* Of a call that fails: how what it is about begins, and the line; "UUID" and "STATUS" stand for the
 * entry's and its own. */
struct Report {
  Call call;
  std::string about;
  const char *function, *text;
};

std::vector<Report> reportsOfFailures() {
  const auto blocks = [](size_t count, size_t size) { return std::to_string(count * size) + " "; };
  const auto entry = [](int type) { return "type " + std::to_string(type) + " "; };
  const char *const init = "2 KARSTResolverInit", *cacheInit = "2 KARSTResolverCacheInit";
  const char *const enable = "2 KARSTResolverCacheEnable";
  const char *const version = "2 KARSTResolverUpdateNodeVersionLocked";
  const char *const tree = "Failed to allocate node rbtree";
  const char *const notFound = "Failed to find node entry UUID: STATUS";
  return {
      {Call::zel_HeapCreate, "", init, "Failed to create heap: STATUS"},
      {Call::zel_LockDomainCreate, "", init, "Failed to create lock domain: STATUS"},
      {Call::zel_SpinlockCreate, "KARSTResolverCache", cacheInit,
       "Failed to create spinlock: STATUS"},
      {Call::zel_HeapAllocWithRA, blocks(KARST_RESOLVER_NODE_POOL_SIZE, sizeof(KARSTResolverNode)),
       cacheInit, "Failed to allocate node pool"},
      {Call::zel_HeapAllocWithRA,
       blocks(KARST_RESOLVER_NETIF_POOL_SIZE, sizeof(KARSTResolverNetIf)), cacheInit,
       "Failed to allocate netif pool"},
      {Call::zel_HeapAllocWithRA, blocks(1, sizeof(KARSTRBTree)), cacheInit, tree},
      {Call::zel_HeapAllocWithRA, blocks(1, sizeof(KARSTRBTreeData)), cacheInit, tree},
      {Call::zel_HeapAllocWithRA, blocks(1, sizeof(KARSTRBTreeNode)), cacheInit, tree},
      {Call::KARST_RegisterStatusCallback, "", cacheInit,
       "Failed to register KARST status callback"},
      {Call::TOLM_WorldCreate, "", enable, "Failed to create world: STATUS"},
      {Call::KARST_Subscribe, entry(KARST_TYPE_NODE), enable,
       "Failed to install node subscription: STATUS"},
      {Call::KARST_Subscribe, entry(KARST_TYPE_NET_INTERFACE), enable,
       "Failed to install netif subscription: STATUS"},
      {Call::KARST_FindFullEntryByQuery, entry(KARST_TYPE_NODE), version, notFound},
      {Call::KARST_FindFullEntryByHeader, "", version, notFound},
      {Call::ExprMsh_UmshSingleStructure, "KarstNodeEntry", version,
       "Failed to unmarshal node entry UUID: STATUS"},
      {Call::ExprMsh_UmshSingleStructure, "KarstNetInterfaceEntry", "2 KARSTResolverUpdateNetIf",
       "Failed to unmarshal netif entry UUID: STATUS"},
      {Call::ExprMsh_UmshSingleStructure, "KarstHealthStatusEntry",
       "2 KARSTResolverUpdateNetIfHealth", "Failed to unmarshal health entry UUID: STATUS"},
      {Call::zel_SpinlockCreate, "KARSTResolverInstance", "2 KARSTResolver_Create",
       "Failed to create spinlock: STATUS"},
      {Call::KARST_Subscribe, entry(objectType), "1 KARSTResolver_Create",
       "Failed to install object subscription: STATUS"},
  };
}

/* In the form of the fixture's log. */
std::vector<std::string> Trial::reports() const {
  static const std::vector<Report> known = reportsOfFailures();
  const auto replaced = [](std::string text, const std::string &word, const std::string &by) {
    const size_t place = text.find(word);
    return place == std::string::npos ? text : text.replace(place, word.size(), by);
  };
  std::vector<std::string> lines;
  std::map<uint32_t, std::string> uuids; /* of the entries that each fiber asked for last */
  for (const sim::HistoryEntry &entry : sim.history()) {
    const std::string about = entry.argument.toString();
    if (about.starts_with("type ")) uuids[entry.fiber] = about.substr(about.rfind(' ') + 1);
    const auto report = std::find_if(known.begin(), known.end(), [&](const Report &one) {
      return one.call == entry.call && (about + " ").starts_with(one.about);
    });
    const auto status = static_cast<zel_Status>(entry.result);
    const bool ofTheLoader =
        entry.call != Call::zel_HeapAllocWithRA || *entry.fiberName == "loader";
    if (status == ZEL_OK || entry.note || report == known.end() || !ofTheLoader) continue;
    std::string text = replaced(report->text, "UUID", uuids[entry.fiber]);
    text = replaced(text, "STATUS", host::statusText(status));
    const std::string function = report->function;
    lines.push_back(function.substr(0, 2) + "KARSTResolver: " + function.substr(2) + ":N: " + text);
  }
  return lines;
}

/* ---- One fault ------------------------------------------------------------------------------- */

/* The directory starts over, and every node changes once more: that wakes the world, and brings
 * each instance up to date. */
void Trial::recover() {
  sim.clearFaults();
  if (!cache()->enabled) enable();
  directory().resync();
  sim.run();
  putNode(99);
  sim.run();
  directory().remove(KARST_TYPE_NODE, nodeUUID(99));
  sim.run();
  for (const host::Entry &entry : directory().entries(KARST_TYPE_HEALTH_STATUS)) {
    KarstHealthStatusEntry other{};
    other.healthFlags = 77;
    putRaw(entry.type, entry.uuid, entry.owner, host::encode(other));
    sim.run();
    directory().put(entry);
    sim.run();
  }
  std::vector<HeldInstance> held;
  for (const Client *client : clients_) {
    if (client->instance == nullptr) continue;
    held.push_back({client->instance, {}});
    if (!client->states.empty()) held.back().told = client->states.back();
  }
  EXPECT_THAT(differencesOf(cache(), directory(), held), IsEmpty());
}

void Trial::leave() {
  for (Client *client : clients_) {
    if (client->instance != nullptr) destroy(*client);
  }
  if (loaded_) unload();
  loaded_ = false;
}

/* How many calls failed. */
uint64_t Trial::tryOut(const Procedure &procedure, Call call, uint64_t nth, uint64_t count,
                       bool toTheEnd) {
  if (procedure.prepare) {
    procedure.prepare(*this);
  } else {
    settle();
  }
  sim.run();
  log.clear();
  sim.clearHistory();
  sim.failAt(call, nth, count);
  procedure.act(*this);
  sim.run();
  const auto failure =
      std::find_if(procedure.failures.begin(), procedure.failures.end(),
                   [&](const auto &row) { return row.call == call && nth <= row.uses; });
  const bool failed = sim.faultsInjected() != 0 && failure != procedure.failures.end();
  EXPECT_EQ(result_, failed ? failure->result : procedure.result);
  std::vector<std::string> expected = reports();
  if (sim.settings().switching == sim::Switching::Random) { /* threads report in any order */
    std::sort(expected.begin(), expected.end());
    std::sort(log.begin(), log.end());
  }
  EXPECT_EQ(log, expected);
  if (!loaded_) {
    EXPECT_THAT(sim.alive(), IsEmpty());
  }
  if (!toTheEnd && failed) {
    sim.clearFaults();
    procedure.act(*this);
    EXPECT_EQ(result_, procedure.result) << "at the second try";
    sim.run();
  }
  if (!toTheEnd && loaded_) recover();
  leave();
  EXPECT_THAT(sim.alive(), IsEmpty());
  return sim.faultsInjected();
}

/* ---- The loop -------------------------------------------------------------------------------- */

class Faults : public ::testing::TestWithParam<std::tuple<Procedure, uint64_t>> {
 protected:
  /* Of 0: each thread runs on until it waits. */
  static sim::Settings settingsOf(uint64_t seed) {
    sim::Settings settings;
    settings.seed = seed;
    settings.switching = seed == 0 ? sim::Switching::WhenBlocked : sim::Switching::Random;
    settings.queueBound = 4;
    settings.historyLength = 1 << 14;
    return settings;
  }

  /* Whether there was such a use, and how many failed. */
  uint64_t tryOut(Call call, uint64_t nth, uint64_t count, bool toTheEnd) {
    const auto &[procedure, seed] = GetParam();
    SCOPED_TRACE(host::formatText(
        "%s, use %llu%s%s", sim::traits(call).name, static_cast<unsigned long long>(nth),
        count == 1 ? "" : " and all further", toTheEnd ? ", to the end" : ""));
    return Trial(settingsOf(seed)).tryOut(procedure, call, nth, count, toTheEnd);
  }
};

TEST_P(Faults, AtEveryUse) {
  const auto &[procedure, seed] = GetParam();
  uint64_t uses = 0;
  uint64_t faults = 0;
  for (size_t i = 0; i < sim::callCount; i++) {
    if (sim::callTraits[i].fault == ZEL_OK) continue;
    const Call call = static_cast<Call>(i);
    for (uint64_t nth = 1; tryOut(call, nth, 1, false) != 0; nth++) {
      ++uses;
      for (const bool toTheEnd : {false, true}) {
        const uint64_t more = tryOut(call, nth, sim::Machine::everyFurther, toTheEnd);
        EXPECT_GE(more, 1u);
        faults += more;
      }
    }
  }
  faults += uses;
  std::cout << procedure.name << ": " << uses << " uses, " << faults << " faults\n";
  EXPECT_GE(uses, procedure.uses);
  EXPECT_EQ(uses == 0, procedure.uses == 0) << "in which nothing can fail";
}

/* "CreateForObject0": the procedure and the seed. */
std::string nameOf(const ::testing::TestParamInfo<Faults::ParamType> &test) {
  return std::get<0>(test.param).name + std::to_string(std::get<1>(test.param));
}

INSTANTIATE_TEST_SUITE_P(Each, Faults,
                         ::testing::Combine(::testing::ValuesIn(Trial::procedures()),
                                            ::testing::Values(0, 1, 2)),
                         nameOf);

/* ---- The directory's picture itself ---------------------------------------------------------- */

TEST_F(ModuleTest, DiffersFromTheDirectoryInWhatIsStillDue) {
  for (uint32_t number = 1; number <= 4; number++) putSimpleNode(number);
  putObject(1, 2);
  start();
  Client client;
  ASSERT_EQ(createForObject(client, 1), ZEL_OK);
  setCallback(client);
  const auto differences = [&] {
    return differencesOf(cache(), directory(), {{client.instance, client.states.back()}});
  };
  EXPECT_THAT(differences(), IsEmpty());
  putHealth(2, 1);
  putNode(3, 9);
  directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(4));
  putNode(5);
  const auto of = [](const zel_UUID &uuid) { return ::testing::HasSubstr(host::toString(uuid)); };
  EXPECT_THAT(differences(),
              ElementsAre(of(netIfUUID(2)), of(nodeUUID(2)), of(nodeUUID(3)), of(nodeUUID(4)),
                          of(nodeUUID(5)), of(objectUUID(1)), of(netIfUUID(4))));
  sim.run();
  EXPECT_THAT(differences(), IsEmpty());
  client.states.back() = KARST_RESOLVER_STATE_RESOLVED;
  EXPECT_THAT(differences(), ElementsAre(of(objectUUID(1)))) << "it was told otherwise";
  destroy(client);
}

}  // namespace
