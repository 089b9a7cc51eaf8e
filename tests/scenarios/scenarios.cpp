/* Scenarios as tables: who acts, what they do how often, on which host. A new one is a new row. No
 * lock.
 */
#include "tests/scenarios/scenarios.h"

#include <algorithm>
#include <set>

#include "sim/random.h"
#include "tests/scenarios/actions.h"
#include "tests/scenarios/cluster.h"

namespace {

using sim::Operation;
using sim::Plan;

struct Weight {
  Action action;
  unsigned weight;
};

struct Actor {
  const char *name;
  unsigned weight; /* its share of the operations */
  std::vector<Weight> actions;
};

struct Profile {
  const char *name;
  const char *about;
  std::vector<Actor> actors;
  size_t length = 400;
  unsigned phases = 4;
  unsigned faults = 0;       /* most that are planned */
  unsigned callbackWork = 2; /* scheduling points */
  bool preemption = true;
  size_t queueBound = 1024;
  uint32_t traceSlots = 1 << 13;      /* enough for all events between two times of rest */
  std::vector<Operation> script = {}; /* of a small scenario: the plan, whatever the seed */
};

/* ---- Who does what --------------------------------------------------------------------------- */

const std::vector<Weight> calls = {
    {Action::Create, 5}, {Action::SetCallback, 4}, {Action::Read, 3}, {Action::Destroy, 3}};
const Actor caller1{"caller-1", 4, calls}, caller2{"caller-2", 4, calls},
    caller3{"caller-3", 4, calls}, reader{"reader", 3, {{Action::Read, 1}}};
const Actor nodes{"nodes", 3, {{Action::PutNode, 4}, {Action::RemoveNode, 3}, {Action::Garble, 1}}};
const Actor netIfs{"interfaces",
                   4,
                   {{Action::PutNetIf, 6},
                    {Action::RemoveNetIf, 3},
                    {Action::PutHealth, 6},
                    {Action::RemoveHealth, 2},
                    {Action::Garble, 1}}};
const Actor objects{"objects", 3, {{Action::PutObject, 5}, {Action::RemoveObject, 3}}};
const Actor floods{"floods", 3, {{Action::Flood, 4}, {Action::Drain, 3}, {Action::Resync, 1}}};
const Actor status{
    "status", 2, {{Action::Usable, 3}, {Action::Unusable, 2}, {Action::Interrupt, 2}}};
const Actor trouble{"trouble", 1, {{Action::Resync, 1}, {Action::Preempt, 1}, {Action::Pause, 1}}};
const Actor loader{"loader", 2, {{Action::Load, 2}, {Action::Unload, 2}, {Action::Pause, 1}}};
const Actor rareLoader{"loader", 1, {{Action::Load, 1}}};

Operation doing(uint8_t phase, uint8_t actor, Action action, uint8_t a = 0, uint8_t b = 0,
                uint8_t c = 0) {
  return {phase, actor, static_cast<uint8_t>(action), a, b, c};
}

/* Node n, its healthy interface n at one IPv4 address, and object n that it owns. */
void putWhole(std::vector<Operation> &operations, uint8_t node) {
  operations.push_back(doing(0, 0, Action::PutNode, node, 0));
  operations.push_back(doing(0, 0, Action::PutHealth, node, 0));
  operations.push_back(doing(0, 0, Action::PutNetIf, node, node, 1));
  operations.push_back(doing(0, 0, Action::PutObject, node, node));
}

/* Two nodes, the module loaded and enabled, and then what overlaps. */
std::vector<Operation> smallScript(std::initializer_list<Operation> overlapping) {
  std::vector<Operation> operations;
  putWhole(operations, 1);
  putWhole(operations, 2);
  operations.push_back(doing(0, 0, Action::Usable));
  operations.push_back(doing(0, 0, Action::Load));
  operations.insert(operations.end(), overlapping);
  return operations;
}

/* ---- The table ------------------------------------------------------------------------------- */

/* Each has a window in its middle that was open once, or could be. Phase 1 prepares, phase 2 is
 * searched. */
std::vector<Profile> smallProfiles() {
  const Operation makeForNode = doing(1, 0, Action::Create, 0, 2);
  const Operation makeForObject = doing(1, 0, Action::Create, 0, 10);
  const Operation listen = doing(1, 0, Action::SetCallback, 0, 1);
  std::vector<Profile> table;
  const auto add = [&](const char *name, const char *about, std::vector<Operation> script) {
    table.push_back({.name = name,
                     .about = about,
                     .actors = {{"first", 1, {}}, {"second", 1, {}}},
                     .preemption = false,
                     .script = std::move(script)});
  };
  add("small-destroy", "an instance is destroyed while its node changes",
      smallScript({makeForNode, listen, doing(2, 0, Action::Destroy, 0),
                   doing(2, 1, Action::PutNetIf, 2, 2, 2)}));
  add("small-move", "an object moves while its node changes and its instance is read",
      smallScript({makeForObject, listen, doing(2, 0, Action::PutObject, 2, 1),
                   doing(2, 0, Action::Read, 0), doing(2, 1, Action::PutHealth, 2, 1)}));
  add("small-unload", "the module goes while the directory is interrupted",
      smallScript({makeForObject, doing(2, 0, Action::Unload), doing(2, 1, Action::Interrupt)}));
  add("small-storm", "an interruption while an instance is made",
      smallScript({doing(2, 0, Action::Create, 0, 1), doing(2, 1, Action::Interrupt)}));
  add("small-object", "an object goes while its instance is made",
      smallScript({doing(2, 0, Action::Create, 0, 10), doing(2, 1, Action::RemoveObject, 2)}));
  add("small-health", "a health entry goes while its interface is new",
      smallScript({doing(1, 0, Action::PutHealth, 3, 0), doing(2, 0, Action::PutNetIf, 3, 2, 1),
                   doing(2, 1, Action::RemoveHealth, 3)}));
  add("small-self", "a node is made during the first enable, which learns who this host is",
      {doing(0, 0, Action::PutNode, 1), doing(0, 0, Action::Load), doing(2, 0, Action::Usable),
       doing(2, 1, Action::Create, 0, 1, 2)});
  add("small-outage", "a node goes while the directory is interrupted",
      smallScript({makeForNode, listen, doing(2, 0, Action::Interrupt),
                   doing(2, 1, Action::RemoveNode, 2)}));
  add("small-return", "an object goes and comes back while the directory is interrupted",
      smallScript({makeForObject, listen, doing(2, 0, Action::Interrupt),
                   doing(2, 1, Action::RemoveObject, 2), doing(2, 1, Action::PutObject, 2, 2)}));
  return table;
}

std::vector<Profile> profiles() {
  std::vector<Profile> table;
  table.push_back({.name = "life",
                   .about = "loads and unloads while the directory's status changes",
                   .actors = {nodes, netIfs, status, loader, caller1}});
  table.push_back({.name = "storms",
                   .about = "enables and disables that overlap with late last calls",
                   .actors = {status, status, nodes, netIfs, caller1}});
  table.push_back({.name = "events",
                   .about = "every kind of entry comes, changes, goes, and is lost in overflows",
                   .actors = {nodes, netIfs, netIfs, objects, trouble, caller1},
                   .length = 600,
                   .queueBound = 2});
  table.push_back({.name = "crowd",
                   .about = "more nodes and interfaces than there are slots",
                   .actors = {floods, netIfs, caller1, rareLoader},
                   .length = 24,
                   .phases = 3,
                   .queueBound = 64,
                   .traceSlots = 1 << 15});
  table.push_back({.name = "churn",
                   .about = "instances come and go under callbacks that take long",
                   .actors = {caller1, caller2, caller3, nodes, netIfs, trouble},
                   .length = 600,
                   .callbackWork = 12});
  table.push_back({.name = "moves",
                   .about = "objects change owners while their instances are refreshed",
                   .actors = {objects, objects, netIfs, caller1, caller2},
                   .length = 480});
  table.push_back({.name = "readers",
                   .about = "several readers of the same instances, and writers",
                   .actors = {reader, reader, reader, netIfs, nodes, caller1}});
  table.push_back({.name = "faults",
                   .about = "platform calls fail at any moment, and everything else goes on",
                   .actors = {nodes, netIfs, objects, status, loader, caller1, caller2, trouble},
                   .faults = 6});

  for (Profile &small : smallProfiles()) table.push_back(std::move(small));
  return table;
}

/* ---- Plans ----------------------------------------------------------------------------------- */

constexpr sim::Call faultable[] = {sim::Call::zel_HeapAllocWithRA,
                                   sim::Call::zel_SpinlockCreate,
                                   sim::Call::TOLM_WorldCreate,
                                   sim::Call::KARST_Subscribe,
                                   sim::Call::KARST_Subscribe,
                                   sim::Call::KARST_FindEntry,
                                   sim::Call::KARST_FindFullEntryByQuery,
                                   sim::Call::KARST_FindFullEntryByHeader,
                                   sim::Call::ExprMsh_UmshSingleStructure,
                                   sim::Call::zel_HeapCreate,
                                   sim::Call::KARST_RegisterStatusCallback};

uint8_t among(sim::Random &random, uint8_t from, uint8_t to) {
  return static_cast<uint8_t>(from + random.below(to - from + size_t{1}));
}

/* One of them, as often as its weight says. */
template <typename Weighted>
size_t chosen(sim::Random &random, const std::vector<Weighted> &all) {
  size_t total = 0;
  for (const Weighted &one : all) total += one.weight;
  size_t point = random.below(total), number = 0;
  while (point >= all[number].weight) point -= all[number++].weight;
  return number;
}

/* Most interfaces keep their owner and most are healthy; instances are of nodes or of objects. */
Operation drawn(sim::Random &random, Action action) {
  const ActionShape &shape = actionShapes[static_cast<size_t>(action)];
  Operation drawn = doing(0, 0, action, among(random, shape.from, shape.a));
  drawn.b = among(random, 0, shape.b);
  drawn.c = among(random, 0, shape.c);
  if (action == Action::PutNetIf)
    drawn.b = random.below(4) == 0 ? among(random, 1, 4) : 1 + drawn.a % 4;
  if (action == Action::PutHealth && random.below(3) == 0) drawn.b = among(random, 0, 2);
  if (action == Action::Create)
    drawn.b = random.below(2) == 0 ? among(random, 1, 4) : among(random, 8, 11);
  return drawn;
}

class Tabled final : public sim::Scenario {
 public:
  explicit Tabled(Profile profile) : profile_(std::move(profile)) {}

  std::string name() const override { return profile_.name; }
  std::string about() const override { return profile_.about; }
  bool small() const override { return !profile_.script.empty(); }
  std::vector<std::string> actors() const override {
    std::vector<std::string> names;
    for (const Actor &actor : profile_.actors) names.emplace_back(actor.name);
    return names;
  }
  std::string describe(const Operation &operation) const override { return textOf(operation); }
  Plan plan(uint64_t seed, size_t length) const override;
  sim::Outcome play(const Plan &plan, const sim::Run &run) const override;

 private:
  void playPhase(Cluster &cluster, const std::vector<Operation> &operations) const;
  bool isKnown(const Plan &plan, uint8_t phase, bool witness) const;

  const Profile profile_;
  mutable std::set<std::pair<uint8_t, bool>> known_;
};

Plan Tabled::plan(uint64_t seed, size_t length) const {
  if (small()) return {profile_.script, {}};
  if (length == 0) length = profile_.length;
  sim::Random random(seed);
  Plan plan;
  for (uint8_t node = 1; node <= 3; node++)
    if (random.below(4) != 0) putWhole(plan.operations, node);
  const bool usableFirst = random.below(2) == 0;
  if (usableFirst) plan.operations.push_back(doing(0, 0, Action::Usable));
  plan.operations.push_back(doing(0, 0, Action::Load));
  if (!usableFirst) plan.operations.push_back(doing(0, 0, Action::Usable));

  for (size_t i = 0; i < length; i++) {
    const auto actor = static_cast<uint8_t>(chosen(random, profile_.actors));
    const std::vector<Weight> &actions = profile_.actors[actor].actions;
    Operation operation = drawn(random, actions[chosen(random, actions)].action);
    operation.actor = actor;
    operation.phase = static_cast<uint8_t>(1 + i * profile_.phases / length);
    plan.operations.push_back(operation);
  }
  /* Among the first uses as often as among many: some calls are made a few times only. */
  for (size_t i = profile_.faults ? random.below(profile_.faults + 1) : 0; i > 0; i--)
    plan.faults.push_back({faultable[random.below(std::size(faultable))],
                           static_cast<uint32_t>(1 + random.below(size_t{4} << random.below(6))),
                           static_cast<uint32_t>(1 + random.below(4))});
  return plan;
}

void Tabled::playPhase(Cluster &cluster, const std::vector<Operation> &operations) const {
  std::vector<std::vector<Operation>> byActor(profile_.actors.size());
  for (const Operation &operation : operations)
    byActor[operation.actor % byActor.size()].push_back(operation);
  for (size_t actor = 0; actor < byActor.size(); actor++) {
    if (byActor[actor].empty()) continue;
    cluster.simulation().spawn(profile_.actors[actor].name, [&cluster, mine = byActor[actor]] {
      for (const Operation &operation : mine) cluster.perform(operation);
    });
  }
}

/* What a small scenario begins with is not part of the search: it takes the same course in each run,
 * and need be checked in the first one of a process only. */
bool Tabled::isKnown(const Plan &plan, uint8_t phase, bool witness) const {
  return plan.operations == profile_.script && plan.faults.empty() &&
         !known_.emplace(phase, witness).second;
}

sim::Outcome Tabled::play(const Plan &plan, const sim::Run &run) const {
  sim::Settings settings;
  settings.seed = run.seed;
  settings.historyLength = run.historyLength;
  settings.stepLimit = run.stepLimit;
  settings.queueBound = profile_.queueBound;
  settings.witness = run.seed % 8 == 0;
  settings.tracing.classLevel = 2;
  settings.tracing.throttling = false;
  settings.tracing.notify = false;
  settings.tracing.slots = profile_.traceSlots;
  Cluster cluster(settings, run.module, profile_.callbackWork);
  sim::Simulation &simulation = cluster.simulation();
  if (profile_.preemption) simulation.setPreemption(sim::Preemption::Random);
  for (const sim::PlannedFault &fault : plan.faults)
    simulation.failAt(fault.call, fault.nth, fault.count);

  for (auto begin = plan.operations.begin(); begin != plan.operations.end();) {
    const uint8_t phase = begin->phase;
    const auto end = std::find_if(begin, plan.operations.end(),
                                  [=](const Operation &one) { return one.phase != phase; });
    const bool searched = !small() || phase > 1;
    if (searched) simulation.setStrategy(std::make_unique<sim::Borrowed>(*run.strategy));
    playPhase(cluster, {begin, end});
    cluster.rest(!searched && !sim::access::watching && isKnown(plan, phase, settings.witness));
    begin = end;
  }
  if (small()) simulation.setSwitching(sim::Switching::WhenBlocked);
  cluster.close();
  return {simulation.steps(), simulation.traceHash(), cluster.performed(),
          simulation.faultsInjected(), cluster.lockstep().checks()};
}

}  // namespace

std::vector<std::unique_ptr<sim::Scenario>> scenarios() {
  std::vector<std::unique_ptr<sim::Scenario>> all;
  for (Profile &profile : profiles()) all.push_back(std::make_unique<Tabled>(std::move(profile)));
  return all;
}
