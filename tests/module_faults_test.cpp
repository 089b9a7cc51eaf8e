/* Every platform call that can fail, failed at each of its uses within each procedure of the
 * module: once, from there on until the host has recovered, and from there on to the end. After
 * each: the documented result and reports, a cache that believes what it could read, nothing left
 * behind, and the directory's own picture once the host works again. */
#include <algorithm>
#include <functional>
#include <iostream>
#include <set>
#include <sstream>
#include <tuple>

#include "host/kernel/text.h"
#include "tests/directory_view.h"
#include "tests/module_fixture.h"

using sim::Call;
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
  std::function<void(Trial &)> prepare;
  std::function<std::string(Trial &)> act; /* its result; a failed one is tried again */
  const char *result;                      /* when nothing fails */
  std::vector<Failure> failures;
  uint64_t uses; /* of calls that can fail: as many at the least, and none only where it is 0 */
};

void PrintTo(const Procedure &procedure, std::ostream *out) {
  *out << procedure.name;
}

/* A call of the past, with the entry that it was about. */
struct Happening {
  Call call;
  zel_Status status;
  std::string fiber;
  std::string argument;
  int type; /* of the entry */
  zel_UUID uuid;
};

/* A cluster of two nodes with an interface each and an object on node 2; three clients. */
class Trial : public ModuleTest {
 public:
  explicit Trial(const sim::Settings &settings) : ModuleTest(settings) {
    directory().setSelf(nodeUUID(1));
  }
  void TestBody() override {}

  static std::vector<Procedure> procedures();
  void tryOut(const Procedure &procedure, Call call, uint64_t nth, uint64_t count, bool toTheEnd);
  uint64_t injected() const { return sim.faultsInjected(); }

 private:
  void populate();
  void settle();
  std::string enable();
  void overflow(const std::function<void(uint32_t)> &change);
  void recover();
  void leave();

  std::vector<HeldInstance> held() const;
  std::vector<Happening> happenings() const;
  std::vector<std::string> reports() const;
  DirectoryView believed();

  bool loaded_ = false;
  Client forNode_, forObject_, forSelf_, created_;
};

/* ---- The procedures -------------------------------------------------------------------------- */

void Trial::populate() {
  putSimpleNode(1);
  putSimpleNode(2);
  putObject(1, 2);
  putObject(2, 2);
}

void Trial::settle() {
  populate();
  start();
  loaded_ = true;
  ASSERT_EQ(createForNode(forNode_, 2), ZEL_OK);
  ASSERT_EQ(createForObject(forObject_, 1), ZEL_OK);
  ASSERT_EQ(createForNode(forSelf_, 1, true), ZEL_OK);
  for (Client *client : {&forNode_, &forObject_, &forSelf_}) setCallback(*client);
}

std::string Trial::enable() {
  directory().setUsable(false);
  sim.run();
  directory().setUsable(true);
  sim.run();
  return cache()->enabled ? "enabled" : "disabled";
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
  const auto settled = [](Trial &t) { t.settle(); };
  const auto load = [](Trial &t) {
    t.loaded_ = t.load().empty();
    return std::string(t.loaded_ ? "loaded" : "refused");
  };
  const auto enable = [](Trial &t) { return t.enable(); };
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
  /* Something happens to a module that is settled. */
  const auto when = [&](const char *name, void (*happens)(Trial &), uint64_t uses) {
    const auto act = [=](Trial &t) {
      happens(t);
      return std::string();
    };
    return Procedure{name, settled, act, "", {}, uses};
  };
  /* A client asks; its failures, and one more where it has one. */
  const auto create = [&](const char *name, zel_UUID object, zel_UUID node, uint64_t uses,
                          std::vector<Procedure::Failure> more = {}) {
    const auto act = [=](Trial &t) -> std::string {
      return host::statusText(t.create(t.created_, object, node));
    };
    more.push_back({Call::zel_HeapAllocWithRA, 1, "ZEL_NO_MEMORY"});
    more.push_back({Call::zel_SpinlockCreate, 1, "ZEL_NO_MEMORY"});
    if (object != noUUID) more.push_back({Call::KARST_Subscribe, 1, "ZEL_NO_MEMORY"});
    return Procedure{name, settled, act, "ZEL_OK", more, uses};
  };
  return {
      {"Load", [](Trial &t) { t.populate(); }, load, "loaded", refused, 11},
      {"LoadAndEnable", [](Trial &t) { t.populate(), t.directory().setUsable(true); }, load,
       "loaded", refused, 40},
      {"Enable", [load](Trial &t) { load(t); }, enable, "enabled", disabled, 3},
      {"EnableAgain", [](Trial &t) { t.settle(), t.directory().setUsable(false); }, enable,
       "enabled", disabled, 29},

      when(
          "NodeAdded", [](Trial &t) { t.putNode(3); }, 3),
      when(
          "NodeChanged",
          [](Trial &t) {
            t.putNode(2, 8, 2, KARST_NODE_FLAG_WITNESS);
            t.sim.run();
            t.putNetIf(2, 2, {"10.0.1.2"}); /* brings the version to the instances */
          },
          6),
      when(
          "NodesOverflow",
          [](Trial &t) {
            t.overflow([&](uint32_t i) { t.putNode(2, 8 + i); });
            t.putNetIf(2, 2, {"10.0.1.2"}); /* likewise */
          },
          24),
      when(
          "NetIfAdded",
          [](Trial &t) {
            t.putHealth(3, 0);
            t.putNetIf(3, 2, {"10.0.0.3", "fd00::3"});
          },
          10),
      when(
          "NetIfOfUnknownNodeAdded", [](Trial &t) { t.putNetIf(4, 4, {"10.0.0.4"}); }, 5),
      when(
          "NetIfChanged", [](Trial &t) { t.putNetIf(2, 2, {"10.0.1.2"}); }, 3),
      when(
          "NetIfMoved", [](Trial &t) { t.putNetIf(2, 1, {"10.0.0.2"}); }, 10),
      when(
          "NetIfsOverflow",
          [](Trial &t) { t.overflow([&](uint32_t i) { t.putNetIf(2, 2, {"10.0.1.2"}, 1 + i); }); },
          21),
      when(
          "HealthChanged", [](Trial &t) { t.putHealth(2, 3); }, 3),
      when(
          "HealthRemoved",
          [](Trial &t) { t.directory().remove(KARST_TYPE_HEALTH_STATUS, netIfUUID(2)); }, 1),
      when(
          "HealthOverflow",
          [](Trial &t) { t.overflow([&](uint32_t i) { t.putHealth(2, 1 + i); }); }, 15),
      when(
          "ObjectRemoved", [](Trial &t) { t.directory().remove(objectType, objectUUID(1)); }, 1),
      when(
          "ObjectMoved", [](Trial &t) { t.putObject(1, 1); }, 1),
      when(
          "ObjectOverflow",
          [](Trial &t) {
            t.overflow([&](uint32_t i) {
              t.putRaw(objectType, objectUUID(1), nodeUUID(2), {static_cast<uint8_t>(i)});
            });
          },
          1),
      when(
          "Resync", [](Trial &t) { t.directory().resync(); }, 25),

      create("CreateForNode", noUUID, nodeUUID(2), 2),
      create("CreateForObject", objectUUID(2), noUUID, 4,
             {{Call::KARST_FindEntry, 1, "ZEL_NOT_FOUND"}}),
      create("CreateForObjectWithHint", objectUUID(2), nodeUUID(2), 4),
      create("CreateForUnknownObjectWithHint", objectUUID(3), nodeUUID(2), 4),

      /* Nothing in these can fail. */
      when(
          "NodeRemoved", [](Trial &t) { t.directory().remove(KARST_TYPE_NODE, nodeUUID(2)); }, 0),
      when(
          "NetIfRemoved",
          [](Trial &t) { t.directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(2)); }, 0),
      when(
          "SetCallback", [](Trial &t) { t.setCallback(t.forNode_); }, 0),
      when(
          "Destroy", [](Trial &t) { t.destroy(t.forObject_); }, 0),
      when(
          "Disable", [](Trial &t) { t.directory().setUsable(false); }, 0),
      when(
          "Unload", [](Trial &t) { t.leave(); }, 0),
  };
}

/* ---- What must have come of it --------------------------------------------------------------- */

std::vector<HeldInstance> Trial::held() const {
  std::vector<HeldInstance> instances;
  for (const Client *client : {&forNode_, &forObject_, &forSelf_, &created_}) {
    if (client->instance == nullptr) continue;
    instances.push_back({client->instance, {}});
    if (!client->states.empty()) instances.back().told = client->states.back();
  }
  return instances;
}

bool isLookup(Call call) {
  return call == Call::KARST_FindEntry || call == Call::KARST_FindFullEntryByQuery ||
         call == Call::KARST_FindFullEntryByHeader;
}

/* The history, with what was decoded named after the entry that was looked up for it. */
std::vector<Happening> Trial::happenings() const {
  std::vector<Happening> found;
  std::map<uint32_t, Happening> lookups; /* the last one of each fiber */
  for (const sim::HistoryEntry &entry : sim.history()) {
    Happening happening{entry.call,
                        static_cast<zel_Status>(entry.result),
                        *entry.fiberName,
                        entry.argument.toString(),
                        0,
                        {}};
    std::string word, uuid;
    std::istringstream words(happening.argument);
    if (words >> word >> happening.type >> uuid && word == "type") {
      happening.uuid = host::parseUUID(uuid).value_or(noUUID);
    }
    if (entry.call == Call::KARST_FindFullEntryByHeader) happening.type = KARST_TYPE_NODE;
    if (entry.call == Call::ExprMsh_UmshSingleStructure) {
      happening.type = lookups[entry.fiber].type;
      happening.uuid = lookups[entry.fiber].uuid;
    } else if (isLookup(entry.call)) {
      lookups[entry.fiber] = happening;
    }
    found.push_back(happening);
  }
  return found;
}

/* What the module has to say about a call that failed; nothing about most. */
std::string reportOf(const Happening &failed) {
  const std::string uuid = host::toString(failed.uuid);
  const bool isNode = failed.type == KARST_TYPE_NODE;
  switch (failed.call) {
    case Call::zel_HeapCreate:
      return "2 KARSTResolverInit: Failed to create heap: ";
    case Call::zel_LockDomainCreate:
      return "2 KARSTResolverInit: Failed to create lock domain: ";
    case Call::zel_SpinlockCreate:
      return failed.fiber == "loader" ? "2 KARSTResolverCacheInit: Failed to create spinlock: "
                                      : "2 KARSTResolver_Create: Failed to create spinlock: ";
    case Call::zel_HeapAllocWithRA: {
      if (failed.fiber != "loader") return "";
      const uint64_t size = std::stoull(failed.argument);
      if (size == sizeof(KARSTResolverCache)) return "";
      const char *what = "node rbtree";
      if (size == KARST_RESOLVER_NODE_POOL_SIZE * sizeof(KARSTResolverNode)) what = "node pool";
      if (size == KARST_RESOLVER_NETIF_POOL_SIZE * sizeof(KARSTResolverNetIf)) what = "netif pool";
      return std::string("2 KARSTResolverCacheInit: Failed to allocate ") + what;
    }
    case Call::KARST_RegisterStatusCallback:
      return "2 KARSTResolverCacheInit: Failed to register KARST status callback";
    case Call::TOLM_WorldCreate:
      return "2 KARSTResolverCacheEnable: Failed to create world: ";
    case Call::KARST_Subscribe:
      if (isNode) return "2 KARSTResolverCacheEnable: Failed to install node subscription: ";
      if (failed.type == KARST_TYPE_NET_INTERFACE)
        return "2 KARSTResolverCacheEnable: Failed to install netif subscription: ";
      if (failed.type == objectType)
        return "1 KARSTResolver_Create: Failed to install object subscription: ";
      return "";
    case Call::KARST_FindFullEntryByQuery:
    case Call::KARST_FindFullEntryByHeader:
      if (!isNode) return "";
      return "2 KARSTResolverUpdateNodeVersionLocked: Failed to find node entry " + uuid + ": ";
    case Call::ExprMsh_UmshSingleStructure:
      if (isNode)
        return "2 KARSTResolverUpdateNodeVersionLocked: Failed to unmarshal node entry " + uuid +
               ": ";
      if (failed.type == KARST_TYPE_NET_INTERFACE)
        return "2 KARSTResolverUpdateNetIf: Failed to unmarshal netif entry " + uuid + ": ";
      return "2 KARSTResolverUpdateNetIfHealth: Failed to unmarshal health entry " + uuid + ": ";
    default:
      return "";
  }
}

/* In the form of the fixture's log. */
std::vector<std::string> Trial::reports() const {
  std::vector<std::string> lines;
  for (const Happening &happening : happenings()) {
    std::string line = happening.status != ZEL_OK ? reportOf(happening) : "";
    if (line.empty()) continue;
    if (line.ends_with(": ")) line += host::statusText(happening.status);
    lines.push_back(line.insert(2, "KARSTResolver: ").insert(line.find(": Failed"), ":N"));
  }
  return lines;
}

/* How the last read of each entry came out, as the history tells. A rescan that ends without an
 * entry counts as a read that did not find it. */
struct Reads {
  using Key = std::pair<int, zel_UUID>;
  std::map<Key, Happening> last;
  std::map<int, std::set<zel_UUID>> listed; /* by type: read well by the rescan that goes on */
  std::set<int> walking;                    /* types that a rescan goes through */

  bool failed(int type, const zel_UUID &uuid) const {
    const auto found = last.find({type, uuid});
    return found != last.end() && found->second.status != ZEL_OK;
  }
  void walkOn(const Happening &step, const std::vector<zel_UUID> &all) {
    if (walking.insert(step.type).second) listed[step.type].clear();
    if (step.status == ZEL_OK) return;
    walking.erase(step.type);
    for (const zel_UUID &uuid : all) {
      if (listed[step.type].count(uuid) == 0) last[{step.type, uuid}] = step;
    }
  }
  void read(const Happening &now) {
    last[{now.type, now.uuid}] = now;
    if (now.status == ZEL_OK) {
      listed[now.type].insert(now.uuid);
    } else {
      listed[now.type].erase(now.uuid);
    }
  }
};

Reads readsOf(const std::vector<Happening> &happenings, const host::Directory &directory) {
  Reads reads;
  for (const Happening &now : happenings) {
    if (now.call == Call::KARST_FindEntry && now.uuid == noUUID) {
      std::vector<zel_UUID> all;
      for (const auto &entry : directory.entries(static_cast<uint8_t>(now.type)))
        all.push_back(entry.uuid);
      reads.walkOn(now, all);
    } else if (now.call == Call::KARST_Subscribe) {
      if (now.type == objectType && now.status == ZEL_OK) reads.read(now); /* tells the entry */
    } else if (isLookup(now.call) || now.call == Call::ExprMsh_UmshSingleStructure) {
      reads.read(now);
    }
  }
  return reads;
}

/* The directory as far as the module could read it. */
DirectoryView Trial::believed() {
  DirectoryView view = viewOf(directory(), nodeUUID(1), false, held());
  view.enabled = cache()->enabled; /* the procedure's result is about this */
  const std::vector<Happening> past = happenings();
  const Reads reads = readsOf(past, directory());
  std::erase_if(view.nodes,
                [&](const auto &node) { return reads.failed(KARST_TYPE_NODE, node.first); });
  std::erase_if(view.netIfs, [&](const auto &netIf) {
    return reads.failed(KARST_TYPE_NET_INTERFACE, netIf.first.second);
  });
  for (auto &[pairing, netIf] : view.netIfs) {
    for (const Happening &now : past) {
      if (now.call != Call::KARST_Subscribe || now.type != KARST_TYPE_HEALTH_STATUS) continue;
      if (now.uuid == pairing.second) netIf.subscribed = now.status == ZEL_OK;
    }
    if (!reads.failed(KARST_TYPE_HEALTH_STATUS, pairing.second)) continue;
    const Call call = reads.last.at({KARST_TYPE_HEALTH_STATUS, pairing.second}).call;
    /* A decoder that was made to fail left the record as it was: zero. */
    std::memset(&netIf.health, call == Call::ExprMsh_UmshSingleStructure ? 0 : 0xff,
                sizeof netIf.health);
  }
  for (DirectoryView::Instance &instance : view.instances) {
    const KARSTResolverInstance &own = *instance.held.instance;
    if (!reads.failed(objectType, own.objectUUID)) continue;
    instance.node = own.useHintNode ? own.hintNodeUUID : noUUID;
  }
  return view;
}

/* ---- One fault ------------------------------------------------------------------------------- */

/* The directory starts over, and every node changes once more: that wakes the world, and brings
 * each instance up to date. */
void Trial::recover() {
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
}

void Trial::leave() {
  for (Client *client : {&forNode_, &forObject_, &forSelf_, &created_}) {
    if (client->instance != nullptr) destroy(*client);
  }
  if (loaded_) unload();
  loaded_ = false;
}

void Trial::tryOut(const Procedure &procedure, Call call, uint64_t nth, uint64_t count,
                   bool toTheEnd) {
  procedure.prepare(*this);
  sim.run();
  log.clear();
  sim.clearHistory();
  sim.failAt(call, nth, count);
  const std::string result = procedure.act(*this);
  sim.run();
  const auto failure =
      std::find_if(procedure.failures.begin(), procedure.failures.end(),
                   [&](const auto &row) { return row.call == call && nth <= row.uses; });
  const bool failed = failure != procedure.failures.end();
  EXPECT_EQ(result, failed ? failure->result : procedure.result);
  std::vector<std::string> expected = reports();
  if (sim.settings().switching == sim::Switching::Random) { /* threads report in any order */
    std::sort(expected.begin(), expected.end());
    std::sort(log.begin(), log.end());
  }
  EXPECT_EQ(log, expected);
  if (loaded_) {
    EXPECT_THAT(differencesOf(cache(), believed()), IsEmpty());
  } else {
    EXPECT_THAT(sim.alive(), IsEmpty());
  }
  if (!toTheEnd) {
    sim.clearFaults();
    if (failed) {
      EXPECT_EQ(procedure.act(*this), procedure.result) << "at the second try";
      sim.run();
    }
    if (loaded_) {
      if (!cache()->enabled) enable();
      recover();
      const DirectoryView view = viewOf(directory(), nodeUUID(1), false, held());
      EXPECT_THAT(differencesOf(cache(), view), IsEmpty());
    }
  }
  leave();
  EXPECT_THAT(sim.alive(), IsEmpty());
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
    Trial trial(settingsOf(seed));
    trial.tryOut(procedure, call, nth, count, toTheEnd);
    return trial.injected();
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

}  // namespace
