/* Every platform call that can fail, failed at each of its uses within each procedure of the
 * module: once, from there on until the host has recovered, and from there on to the end. After
 * each: the documented result and reports, nothing left behind, and the directory's own picture once
 * the host works again. */
#include <algorithm>
#include <functional>
#include <iostream>

#include "host/kernel/text.h"
#include "tests/directory_view.h"
#include "tests/module_fixture.h"

using host::formatText;
using sim::Call;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

constexpr zel_Status failure = 0x0bad0777; /* that nobody knows: it is passed on as it is */

/* A cluster of two nodes with an interface each and two objects on node 2; four clients. */
class Trial : public Bench {
 public:
  explicit Trial(const sim::Settings &settings) : Bench(settings) {
    directory().setSelf(nodeUUID(1));
    putSimpleNode(1);
    putSimpleNode(2);
    putObject(1, 2);
    putObject(2, 2);
  }

  void settle();
  void recover();
  void leave();

  void loadIt() { result = load().empty() ? "loaded" : "refused"; }
  void enable();
  void changeEntries();
  void loseChanges();
  void askFor(const zel_UUID &object, const zel_UUID &node) {
    result = host::statusText(create(created, object, node));
  }

  std::string result; /* of the procedure, where it has one */
  Client forNode, forObject, forSelf, created;
  const std::vector<Client *> clients = {&forNode, &forObject, &forSelf, &created};
};

void Trial::settle() {
  start();
  ASSERT_EQ(create(forNode, noUUID, nodeUUID(2)), ZEL_OK);
  ASSERT_EQ(create(forObject, objectUUID(1), noUUID), ZEL_OK);
  ASSERT_EQ(create(forSelf, noUUID, nodeUUID(1), true), ZEL_OK);
  for (Client *client : {&forNode, &forObject, &forSelf}) setCallback(*client);
}

/* The directory starts over, and every node goes and comes back: that wakes the world, and brings
 * each instance up to date. */
void Trial::recover() {
  sim.clearFaults();
  if (!cache()->enabled) enable();
  directory().resync();
  sim.run();
  const std::vector<host::Entry> nodes = directory().entries(KARST_TYPE_NODE);
  for (const host::Entry &node : nodes) directory().remove(node.type, node.uuid);
  sim.run();
  for (const host::Entry &node : nodes) directory().put(node);
  sim.run();
  std::vector<HeldInstance> held;
  for (const Client *client : clients) {
    if (client->instance == nullptr) continue;
    held.push_back({client->instance, {}});
    if (!client->states.empty()) held.back().told = client->states.back();
  }
  EXPECT_THAT(differencesOf(cache(), directory(), held), IsEmpty());
}

void Trial::leave() {
  for (Client *client : clients) {
    if (client->instance != nullptr) destroy(*client);
  }
  if (module != nullptr) unload();
}

/* ---- The procedures -------------------------------------------------------------------------- */

void Trial::enable() {
  directory().setUsable(false);
  sim.run();
  directory().setUsable(true);
  sim.run();
  result = cache()->enabled ? "enabled" : "disabled";
}

void Trial::changeEntries() {
  const std::function<void()> changes[] = {
      [&] { putNode(3); },
      [&] { putNode(2, 8, 2, KARST_NODE_FLAG_WITNESS); },
      [&] { putNetIf(2, 2, {"10.0.1.2"}); }, /* brings the version to the instances */
      [&] { putHealth(2, 1); },
      [&] { putHealth(3, 0); },
      [&] {
        putNetIf(3, 2, {"10.0.0.3", "fd00::3"});
      },
      [&] { putNetIf(4, 4, {"10.0.0.4"}); }, /* of a node that is not known */
      [&] { putNetIf(2, 1, {"10.0.0.2"}); }, /* of another one than before */
      [&] { putHealth(2, 3); },
      [&] { putNode(4); },
      [&] { putHealth(4, 0); },
      [&] { directory().remove(KARST_TYPE_HEALTH_STATUS, netIfUUID(2)); },
      [&] { directory().remove(objectType, objectUUID(1)); },
      [&] { putObject(1, 1); },
      [&] { directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(2)); },
      [&] { directory().remove(KARST_TYPE_NODE, nodeUUID(2)); },
  };
  for (const auto &change : changes) {
    change();
    sim.run();
  }
}

/* More changes than a subscription keeps, before it is told of any; of each kind. */
void Trial::loseChanges() {
  const std::function<void(uint8_t)> changes[] = {
      [&](uint8_t i) { putNode(2, 8 + i); },
      [&](uint8_t i) { putNetIf(2, 2, {"10.0.1.2"}, 1 + i); },
      [&](uint8_t i) { putHealth(2, 1 + i); },
      [&](uint8_t i) { putObject(1, 2, i); },
  };
  const uint64_t before = directory().overflows();
  for (const auto &change : changes) {
    sim.hold("karst-delivery");
    for (uint8_t i = 0; i <= sim.settings().queueBound; i++) change(i);
    sim.release("karst-delivery");
    sim.run();
  }
  if (sim.faultsInjected() == 0) {
    EXPECT_EQ(directory().overflows(), before + std::size(changes));
  }
  directory().resync();
}

struct Procedure {
  /* The uses of a call, from the first on, whose failure has another result. */
  struct Failure {
    Call call;
    uint64_t uses;
    std::string result;
  };
  const char *name;
  uint64_t uses;                    /* of calls that can fail: at the least; 0: of none */
  std::function<void(Trial &)> act; /* leaves its result; a failed one is tried again */
  const char *result = "";          /* when nothing fails */
  std::vector<Failure> failures = {};
  void (*prepare)(Trial &) = [](Trial &t) { t.settle(); };
};

std::vector<Procedure> procedures() {
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
  const std::vector<Procedure::Failure> notMade = {
      {Call::zel_HeapAllocWithRA, 1, "ZEL_NO_MEMORY"},
      {Call::zel_SpinlockCreate, 1, host::statusText(failure)},
      {Call::KARST_Subscribe, 1, host::statusText(failure)},
  };
  std::vector<Procedure::Failure> orNotFound = notMade;
  orNotFound.push_back({Call::KARST_FindEntry, 1, "ZEL_NOT_FOUND"});
  const auto setUsable = [](Trial &t) { t.directory().setUsable(true); };
  return {
      {"Load", 11, &Trial::loadIt, "loaded", refused, [](Trial &) {}},
      {"LoadAndEnable", 40, &Trial::loadIt, "loaded", refused, setUsable},
      {"Enable", 29, &Trial::enable, "enabled", disabled, [](Trial &t) { t.loadIt(); }},
      {"EnableAgain", 48, &Trial::enable, "enabled", disabled},
      {"ChangeEntries", 49, &Trial::changeEntries},
      {"LoseChanges", 83, &Trial::loseChanges},
      {"CreateForNode", 2, [](Trial &t) { t.askFor(noUUID, nodeUUID(2)); }, "ZEL_OK", notMade},
      {"CreateForObject", 4, [](Trial &t) { t.askFor(objectUUID(2), noUUID); }, "ZEL_OK",
       orNotFound},
      {"CreateWithHint", 4, [](Trial &t) { t.askFor(objectUUID(2), nodeUUID(2)); }, "ZEL_OK",
       notMade},
      {"CreateWithHintAlone", 5, [](Trial &t) { t.askFor(objectUUID(3), nodeUUID(2)); }, "ZEL_OK",
       notMade},
      {"SetCallback", 0, [](Trial &t) { t.setCallback(t.forNode); }},
      {"Disable", 0, [](Trial &t) { t.directory().setUsable(false); }},
      {"DestroyAndUnload", 0, [](Trial &t) { t.leave(); }},
  };
}

/* ---- What must have been reported ------------------------------------------------------------ */

/* Of a call that fails: how what it is about begins, and the line; "UUID" and "STATUS" stand for the
 * entry's and its own. */
struct Report {
  Call call;
  std::string about;
  int urgency;
  const char *function, *text;
};

std::vector<Report> reportsOfFailures() {
  const auto blocks = [](size_t count, size_t size) { return std::to_string(count * size) + " "; };
  const auto entry = [](int type) { return "type " + std::to_string(type) + " "; };
  const char *const init = "KARSTResolverInit", *cacheInit = "KARSTResolverCacheInit";
  const char *const enable = "KARSTResolverCacheEnable", *createIt = "KARSTResolver_Create";
  const char *const version = "KARSTResolverUpdateNodeVersionLocked";
  const char *const noLock = "Failed to create spinlock: STATUS";
  const char *const noTree = "Failed to allocate node rbtree";
  const char *const notFound = "Failed to find node entry UUID: STATUS";
  return {
      {Call::zel_HeapCreate, "", 2, init, "Failed to create heap: STATUS"},
      {Call::zel_LockDomainCreate, "", 2, init, "Failed to create lock domain: STATUS"},
      {Call::zel_SpinlockCreate, "KARSTResolverCache", 2, cacheInit, noLock},
      {Call::zel_HeapAllocWithRA, blocks(KARST_RESOLVER_NODE_POOL_SIZE, sizeof(KARSTResolverNode)),
       2, cacheInit, "Failed to allocate node pool"},
      {Call::zel_HeapAllocWithRA,
       blocks(KARST_RESOLVER_NETIF_POOL_SIZE, sizeof(KARSTResolverNetIf)), 2, cacheInit,
       "Failed to allocate netif pool"},
      {Call::zel_HeapAllocWithRA, blocks(1, sizeof(KARSTRBTree)), 2, cacheInit, noTree},
      {Call::zel_HeapAllocWithRA, blocks(1, sizeof(KARSTRBTreeData)), 2, cacheInit, noTree},
      {Call::zel_HeapAllocWithRA, blocks(1, sizeof(KARSTRBTreeNode)), 2, cacheInit, noTree},
      {Call::KARST_RegisterStatusCallback, "", 2, cacheInit,
       "Failed to register KARST status callback"},
      {Call::TOLM_WorldCreate, "", 2, enable, "Failed to create world: STATUS"},
      {Call::KARST_Subscribe, entry(KARST_TYPE_NODE), 2, enable,
       "Failed to install node subscription: STATUS"},
      {Call::KARST_Subscribe, entry(KARST_TYPE_NET_INTERFACE), 2, enable,
       "Failed to install netif subscription: STATUS"},
      {Call::KARST_FindFullEntryByQuery, entry(KARST_TYPE_NODE), 2, version, notFound},
      {Call::KARST_FindFullEntryByHeader, "", 2, version, notFound},
      {Call::ExprMsh_UmshSingleStructure, "KarstNodeEntry", 2, version,
       "Failed to unmarshal node entry UUID: STATUS"},
      {Call::ExprMsh_UmshSingleStructure, "KarstNetInterfaceEntry", 2, "KARSTResolverUpdateNetIf",
       "Failed to unmarshal netif entry UUID: STATUS"},
      {Call::ExprMsh_UmshSingleStructure, "KarstHealthStatusEntry", 2,
       "KARSTResolverUpdateNetIfHealth", "Failed to unmarshal health entry UUID: STATUS"},
      {Call::zel_SpinlockCreate, "KARSTResolverInstance", 2, createIt, noLock},
      {Call::KARST_Subscribe, entry(objectType), 1, createIt,
       "Failed to install object subscription: STATUS"},
  };
}

/* In the form of the bench's log. */
std::vector<std::string> reportsOf(const std::vector<sim::HistoryEntry> &history) {
  static const std::vector<Report> known = reportsOfFailures();
  std::vector<std::string> lines;
  std::map<uint32_t, std::string> uuids; /* of the entries that each fiber asked for last */
  for (const sim::HistoryEntry &entry : history) {
    const std::string about = entry.argument.toString();
    if (about.starts_with("type ")) uuids[entry.fiber] = about.substr(about.rfind(' ') + 1);
    const auto report = std::find_if(known.begin(), known.end(), [&](const Report &one) {
      return one.call == entry.call && (about + " ").starts_with(one.about);
    });
    const auto status = static_cast<zel_Status>(entry.result);
    const bool ofTheLoader =
        entry.call != Call::zel_HeapAllocWithRA || *entry.fiberName == "loader";
    if (status == ZEL_OK || entry.note || report == known.end() || !ofTheLoader) continue;
    std::string line =
        formatText("%d KARSTResolver: %s:N: %s", report->urgency, report->function, report->text);
    line = std::regex_replace(line, std::regex("UUID"), uuids[entry.fiber]);
    lines.push_back(std::regex_replace(line, std::regex("STATUS"), host::statusText(status)));
  }
  return lines;
}

/* ---- One fault, and every one ---------------------------------------------------------------- */

struct Fault {
  Call call;
  uint64_t nth;
  bool once, toTheEnd;
};

/* How many calls failed. Of seed 0: each thread runs on until it waits. */
uint64_t tryOut(const Procedure &procedure, uint64_t seed, const Fault &fault) {
  SCOPED_TRACE(formatText(
      "%s, seed %lu: %s, use %lu%s%s", procedure.name, seed, sim::traits(fault.call).name,
      fault.nth, fault.once ? "" : " and all further", fault.toTheEnd ? ", to the end" : ""));
  sim::Settings settings;
  settings.seed = seed;
  settings.switching = seed == 0 ? sim::Switching::WhenBlocked : sim::Switching::Random;
  settings.queueBound = 4;
  settings.historyLength = 1 << 14;
  Trial trial(settings);
  procedure.prepare(trial);
  trial.sim.run();
  trial.log.clear();
  trial.sim.clearHistory();
  trial.sim.failAt(fault.call, fault.nth, fault.once ? 1 : sim::Machine::everyFurther, failure);
  procedure.act(trial);
  trial.sim.run();

  const auto other = std::find_if(
      procedure.failures.begin(), procedure.failures.end(),
      [&](const auto &row) { return row.call == fault.call && fault.nth <= row.uses; });
  const bool failed = trial.sim.faultsInjected() != 0 && other != procedure.failures.end();
  EXPECT_EQ(trial.result, failed ? other->result : procedure.result);
  std::vector<std::string> expected = reportsOf(trial.sim.history());
  if (seed != 0) { /* threads report in any order */
    std::sort(expected.begin(), expected.end());
    std::sort(trial.log.begin(), trial.log.end());
  }
  EXPECT_EQ(trial.log, expected);
  if (!fault.toTheEnd && failed) {
    trial.sim.clearFaults();
    procedure.act(trial);
    EXPECT_EQ(trial.result, procedure.result) << "at the second try";
    trial.sim.run();
  }
  if (!fault.toTheEnd && trial.module != nullptr) trial.recover();
  trial.leave();
  EXPECT_THAT(trial.sim.alive(), IsEmpty());
  return trial.sim.faultsInjected();
}

TEST(Faults, AtEveryUse) {
  uint64_t allUses = 0, allFaults = 0;
  for (const Procedure &procedure : procedures()) {
    for (const uint64_t seed : {0, 1, 2}) {
      uint64_t uses = 0, faults = 0;
      for (size_t i = 0; i < sim::callCount; i++) {
        if (sim::callTraits[i].fault == ZEL_OK) continue;
        const Call call = static_cast<Call>(i);
        for (uint64_t nth = 1; tryOut(procedure, seed, {call, nth, true, false}) != 0; nth++) {
          ++uses;
          for (const bool toTheEnd : {false, true}) {
            faults += tryOut(procedure, seed, {call, nth, false, toTheEnd});
          }
        }
      }
      std::cout << procedure.name << ": " << uses << " uses, " << faults + uses << " faults\n";
      EXPECT_GE(uses, procedure.uses);
      EXPECT_EQ(uses == 0, procedure.uses == 0) << "in which nothing can fail";
      allUses += uses;
      allFaults += faults + uses;
    }
  }
  std::cout << allFaults << " failures at " << allUses << " places\n";
}

/* ---- The directory's picture itself ---------------------------------------------------------- */

TEST_F(ModuleTest, DiffersFromTheDirectoryInWhatIsStillDue) {
  for (uint32_t number = 1; number <= 4; number++) putSimpleNode(number);
  putObject(1, 2);
  start();
  Client client;
  ASSERT_EQ(create(client, objectUUID(1), noUUID), ZEL_OK);
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
