/* The model beside the module; see lockstep.h. Every member of the module that is read here is read
 * where its lock is held or nothing runs, which the analysis cannot see.
 */
#include "tests/scenarios/lockstep.h"

#include <algorithm>
#include <cstring>
#include <span>

#include "host/kernel/panic.h"
#include "host/kernel/uuid.h"
#include "sim/access/access.h"
#include "tests/scenarios/guards.h"

namespace {

constexpr const char *cacheLockName = "KARSTResolverCache";

bool isCacheLock(const sim::Spinlock &lock) {
  return std::strcmp(lock.name.text, cacheLockName) == 0;
}

uint8_t typeOf(const char *record) {
  if (std::strcmp(record, "KarstNodeEntry") == 0) return KARST_TYPE_NODE;
  if (std::strcmp(record, "KarstNetInterfaceEntry") == 0) return KARST_TYPE_NET_INTERFACE;
  return KARST_TYPE_HEALTH_STATUS;
}

size_t sizeOf(uint8_t type) {
  if (type == KARST_TYPE_NODE) return sizeof(KarstNodeEntry);
  if (type == KARST_TYPE_NET_INTERFACE) return sizeof(KarstNetInterfaceEntry);
  return sizeof(KarstHealthStatusEntry);
}

std::string name(const zel_UUID &uuid) {
  return host::toString(uuid);
}

/* "<what> of <whose> is <real> and should be <wanted>" */
template <typename Value>
void require(Value real, Value wanted, const char *what, const zel_UUID &whose) {
  if (real == wanted) return;
  host::panic("lockstep: %s of %s is %lld, and should be %lld", what, name(whose).c_str(),
              static_cast<long long>(real), static_cast<long long>(wanted));
}

void requireSections(unsigned sections, unsigned wanted) {
  if (sections == wanted) return;
  host::panic("lockstep: a callback has passed through %u critical sections, not %u", sections,
              wanted);
}

/* In use, by its tag. */
template <typename Slot>
bool isTagged(const Slot &slot, const char *tag) {
  return std::memcmp(slot.tag, tag, sizeof slot.tag) == 0;
}

/* The module's and the model's are the same. */
template <typename Element, typename Slot>
bool isAt(const Element &element, const Slot &slot) {
  return element.slot ? element.slot == &slot : element.uuid == slot.uuid;
}

template <typename Element, typename Slot>
void requireAt(const Element &element, const Slot &slot) {
  if (!isAt(element, slot))
    host::panic("lockstep: %s stands on a list where %s should", name(slot.uuid).c_str(),
                name(element.uuid).c_str());
}

/* Each on a list beside the one that it should be. `links`: where an element has its own. */
template <typename Real, typename Wanted, typename Compare>
void compareList(const Wanted &wanted, const KARSTResolverLink &head, size_t links,
                 const char *what, const zel_UUID &whose, Compare compare) {
  auto next = wanted.begin();
  for (KARSTResolverLink *link = head.next; link != &head; link = link->next) {
    if (next == wanted.end())
      host::panic("lockstep: there are more %s of %s than there should be", what,
                  name(whose).c_str());
    compare(**next++, *reinterpret_cast<Real *>(reinterpret_cast<uint8_t *>(link) - links));
  }
  if (next != wanted.end())
    host::panic("lockstep: there are fewer %s of %s than there should be", what,
                name(whose).c_str());
}

/* A list begins and ends with those that it should. */
template <typename Real, typename Wanted>
void requireEnds(const Wanted &wanted, const KARSTResolverLink &head, size_t links,
                 const char *what) {
  const auto is = [&](const KARSTResolverLink *link, const auto *element) {
    const auto *bytes = reinterpret_cast<const uint8_t *>(link) - links;
    return link != &head && isAt(*element, *reinterpret_cast<const Real *>(bytes));
  };
  if (wanted.empty() ? head.next == &head
                     : is(head.next, wanted.front()) && is(head.previous, wanted.back()))
    return;
  host::panic("lockstep: another %s than it should is the first or last one", what);
}

}  // namespace

Lockstep::Lockstep(sim::Simulation &simulation) : simulation_(simulation) {}

/* ---- Life ------------------------------------------------------------------------------------ */

void Lockstep::statusRegistered(sim::Fiber &, void *data, zel_Status status) {
  if (status != ZEL_OK) return;
  model_ = std::make_unique<model::Resolver>(simulation_.settings().witness);
  cache_ = static_cast<KARSTResolverCache *>(data);
  declareCacheGuards(simulation_, *cache_);
}

void Lockstep::moduleComesOrGoes() {
  begin(simulation_.scheduler().running(), Activity::Disable);
}

void Lockstep::moduleIsGone() {
  end(simulation_.scheduler().running());
  if (!activities_.empty())
    host::panic("lockstep: the module is gone, and fiber %u is still inside it",
                activities_.front().fiber);
  cache_ = nullptr;
  if (!alive_.empty()) host::panic("lockstep: the module is gone, and an instance is not");
  if (model_ && (!model_->nodes.empty() || !model_->slots.empty() || cacheSubscriptions_ != 0))
    host::panic(
        "lockstep: the module is gone, and %zu nodes, %zu interfaces, %zu subscriptions not",
        model_->nodes.size(), model_->slots.size(), cacheSubscriptions_);
  model_.reset();
}

void Lockstep::moduleIsThere() {
  end(simulation_.scheduler().running());
}

/* ---- What fibers do -------------------------------------------------------------------------- */

Lockstep::Activity &Lockstep::begin(const sim::Fiber &fiber, Activity::Kind kind) {
  Activity *before = find(fiber.id());
  Activity &activity = before ? *before : activities_.emplace_back();
  activity = Activity{};
  activity.fiber = fiber.id();
  activity.kind = kind;
  return activity;
}

Lockstep::Activity *Lockstep::find(uint32_t fiber) {
  for (Activity &activity : activities_)
    if (activity.fiber == fiber) return &activity;
  return nullptr;
}

Lockstep::Activity *Lockstep::of(const sim::Fiber &fiber) {
  if (Activity *activity = find(fiber.id())) return activity;
  return fiber.world ? &begin(fiber, Activity::World) : nullptr;
}

void Lockstep::end(const sim::Fiber &fiber) {
  std::erase_if(activities_, [&](const Activity &one) { return one.fiber == fiber.id(); });
}

void Lockstep::subscriptionCalls(sim::Fiber &fiber, const sim::SubscriptionCall &call) {
  const Activity::Kind kind = call.type == KARST_TYPE_NODE            ? Activity::Nodes
                              : call.type == KARST_TYPE_NET_INTERFACE ? Activity::NetIfs
                              : call.type == KARST_TYPE_HEALTH_STATUS ? Activity::Health
                                                                      : Activity::Object;
  Activity &activity = begin(fiber, kind);
  activity.header = *call.header;
  activity.status = call.status;
  activity.data = call.data;
  const bool rescan = call.status == ZEL_SUB_RESYNC || call.status == ZEL_SUB_OVERFLOW;
  if (kind == Activity::Nodes && rescan) ++counts_.nodeRescans;
  if (kind == Activity::NetIfs && rescan) ++counts_.netIfRescans;
  if (kind != Activity::Object || call.status == ZEL_SUB_CANCELLED) return;
  activity.instance = &instanceOf(call.data);
  if (call.status == ZEL_OK) {
    activity.found = true;
    want(activity, call.header->owner);
  }
}

void Lockstep::subscriptionReturned(sim::Fiber &fiber, const sim::SubscriptionCall &call) {
  Activity &activity = *find(fiber.id());
  const bool cancelled = call.status == ZEL_SUB_CANCELLED;
  switch (activity.kind) {
    case Activity::Nodes:
    case Activity::NetIfs:
      if (cancelled) --cacheSubscriptions_;
      requireSections(activity.sections, cancelled ? 0 : 1);
      break;
    case Activity::Health:
      requireSections(activity.sections, 1);
      break;
    default:
      if (!cancelled) objectReturned(activity);
  }
  end(fiber);
}

void Lockstep::statusCalls(sim::Fiber &fiber, uint32_t status) {
  begin(fiber, status & KARST_STATUS_USABLE ? Activity::Enable : Activity::Disable);
}

void Lockstep::statusReturned(sim::Fiber &fiber, uint32_t) {
  const Activity &activity = *find(fiber.id());
  const bool enabling = activity.kind == Activity::Enable && !activity.failed;
  if (enabling ? activity.sections != 2 : activity.disabling == 1)
    host::panic("lockstep: a status call has ended half-way");
  end(fiber);
}

model::Instance &Lockstep::creating(const zel_UUID &object, const zel_UUID &node, bool local) {
  Known &instance = instances_.emplace_back();
  alive_.push_back(&instance);
  instance.object = object;
  instance.local = local;
  Activity &activity = begin(simulation_.scheduler().running(), Activity::Create);
  activity.instance = &instance;
  if (host::isZero(object)) {
    activity.wanted = node;
  } else {
    instance.hint = node;
    instance.useHint = !host::isZero(node);
  }
  return instance;
}

void Lockstep::created(zel_Status status) {
  Activity &activity = *find(simulation_.scheduler().running().id());
  model::Instance &instance = *activity.instance;
  const bool good = status == ZEL_OK ? !instance.destroyed && !activity.failed
                                     : instance.destroyed || activity.sections == 0;
  if (!good)
    host::panic("lockstep: create returned 0x%x after %u sections, destroyed %d", status,
                activity.sections, instance.destroyed);
  if (activity.sections > 0) ++counts_.creates;
  if (status == ZEL_OK) {
    requireResolved(known(instance));
  } else {
    if (activity.sections > 0) ++counts_.destroys;
    std::erase(alive_, &known(instance));
  }
  end(simulation_.scheduler().running());
}

/* At some time since its first tracking; perhaps by a section that has not ended. */
void Lockstep::requireResolved(Known &made) KARST_UNCHECKED {
  for (const model::Answer &one : made.answers)
    if (one.state == KARST_RESOLVER_STATE_RESOLVED) return;
  if (!made.real || made.real->state != KARST_RESOLVER_STATE_RESOLVED)
    host::panic("lockstep: create succeeded, and the instance never was resolved");
  made.expected.push_back(model::Answer::of(made.real->state, made.real->locators));
}

void Lockstep::destroying(model::Instance &instance) {
  begin(simulation_.scheduler().running(), Activity::Destroy).instance = &instance;
}

void Lockstep::destroyed() {
  Activity &activity = *find(simulation_.scheduler().running().id());
  if (activity.sections != 1) host::panic("lockstep: destroy took %u sections", activity.sections);
  ++counts_.destroys;
  std::erase(alive_, &known(*activity.instance));
  end(simulation_.scheduler().running());
}

/* ---- What the platform answers --------------------------------------------------------------- */

void Lockstep::lookedUp(sim::Fiber &fiber, const sim::Lookup &lookup) {
  Activity *activity = of(fiber);
  if (!activity) return;
  const KarstEntryHeader header = lookup.header ? *lookup.header : KarstEntryHeader{};
  if (activity->instance) { /* the object's entry */
    model::Instance &instance = *activity->instance;
    activity->found = lookup.status == ZEL_OK;
    if (activity->found) {
      want(*activity, header.owner);
    } else {
      want(*activity, instance.useHint ? instance.hint : zel_UUID{});
    }
    return;
  }
  const auto kind =
      lookup.call == sim::Call::KARST_FindEntry ? model::Input::Find : model::Input::FindWhole;
  activity->inputs.add({kind, lookup.type, lookup.uuid, lookup.status, header, {}, nullptr});
}

void Lockstep::decoded(sim::Fiber &fiber, const char *record, zel_Status status,
                       const void *content) {
  Activity *activity = of(fiber);
  if (!activity) return;
  const uint8_t type = typeOf(record);
  const auto *bytes = static_cast<const uint8_t *>(content);
  activity->inputs.add(
      {model::Input::Decoded, type, {}, status, {}, {bytes, bytes + sizeOf(type)}, nullptr});
}

void Lockstep::toldSelf(sim::Fiber &fiber, const zel_UUID &uuid) {
  if (Activity *activity = of(fiber)) {
    KarstEntryHeader header{};
    header.uuid = uuid;
    activity->inputs.add({model::Input::Self, 0, {}, ZEL_OK, header, {}, nullptr});
  }
}

void Lockstep::subscribed(sim::Fiber &fiber, const KarstQuery &query, void *data,
                          zel_Status status) {
  Activity *activity = of(fiber);
  if (!activity) return;
  switch (query.type) {
    case KARST_TYPE_HEALTH_STATUS:
      activity->inputs.add(
          {model::Input::Subscribed, query.type, query.uuid, status, {}, {}, data});
      return;
    case KARST_TYPE_NODE:
    case KARST_TYPE_NET_INTERFACE:
      if (status == ZEL_OK) ++cacheSubscriptions_;
      activity->failed |= status != ZEL_OK;
      return;
    default: /* the object's, in a create; calls may come from here on */
      if (activity->found) activity->instance->useHint = false;
      activity->failed |= status != ZEL_OK;
  }
}

void Lockstep::worldCreated(sim::Fiber &fiber, zel_Status status) {
  if (Activity *activity = of(fiber)) activity->failed |= status != ZEL_OK;
}

void Lockstep::worldWaited(sim::Fiber &fiber, zel_Status status) {
  if (status != ZEL_WORLD_STOPPING) return;
  model_->worldEnds();
  end(fiber);
}

void Lockstep::preemptionAnswered(sim::Fiber &fiber, bool yes) {
  if (Activity *activity = of(fiber))
    activity->inputs.add({model::Input::Preemption, 0, {}, yes, {}, {}, nullptr});
}

/* ---- Sections -------------------------------------------------------------------------------- */

void Lockstep::locked(sim::Fiber &fiber, const sim::Spinlock &lock) {
  if (isCacheLock(lock) && !of(fiber))
    host::panic("lockstep: %s takes the cache lock for no reason that is known",
                fiber.name().c_str());
}

void Lockstep::unlocking(sim::Fiber &fiber, const sim::Spinlock &lock) {
  if (!isCacheLock(lock) || !cache_) return;
  Activity &activity = *of(fiber);
  step(activity);
  ++activity.sections;
  ++sections_;
  if (!activity.inputs.empty())
    host::panic("lockstep: %s asked for more than it needs", fiber.name().c_str());
  answersGrew();
  for (Activity &other : activities_) look(other);
  compareSection();
}

void Lockstep::step(Activity &activity) {
  switch (activity.kind) {
    case Activity::Nodes:
      return model_->nodeCall(activity.header, activity.status, activity.inputs);
    case Activity::NetIfs:
      return model_->netIfCall(activity.header, activity.status, activity.inputs);
    case Activity::Health:
      return model_->healthCall(activity.data, activity.status, activity.inputs);
    case Activity::World:
      return model_->worldSection(activity.inputs);
    case Activity::Enable:
      return stepEnable(activity);
    case Activity::Disable:
      return stepDisable(activity);
    case Activity::Create:
      if (activity.sections == 0) return; /* a reference, on which no lock depends */
      [[fallthrough]];
    case Activity::Object:
      return stepTracking(activity);
    case Activity::Destroy:
      return model_->destroy(*activity.instance);
  }
}

void Lockstep::stepEnable(Activity &activity) {
  if (activity.failed) {
    stepDisable(activity);
  } else if (activity.sections == 0) {
    model_->enabled = true;
  } else {
    model_->learnSelf(activity.inputs);
  }
}

void Lockstep::stepDisable(Activity &activity) {
  if (activity.disabling == 1) {
    model_->forgetEntries();
    activity.disabling = 2;
  } else if (model_->enabled) {
    model_->enabled = false;
    activity.disabling = 1;
  }
}

/* ---- Tracking -------------------------------------------------------------------------------- */

void Lockstep::want(Activity &activity, const zel_UUID &node) {
  activity.wanted = node;
  look(activity);
}

void Lockstep::look(Activity &activity) {
  if (!activity.instance || !activity.wanted || activity.tracked) return;
  if (model::Resolver::tracksAlready(*activity.instance, *activity.wanted)) {
    activity.mayStay = true;
  } else {
    activity.mayMove = true;
  }
}

void Lockstep::stepTracking(Activity &activity) {
  look(activity);
  if (activity.kind == Activity::Create && (activity.tracked || !activity.mayMove))
    return model_->destroy(*activity.instance); /* of an instance that came to nothing */
  if (!activity.mayMove || activity.tracked)
    host::panic("lockstep: an instance is tracked though there is nothing to change");
  activity.tracked = true;
  model_->track(*activity.instance, *activity.wanted);
}

void Lockstep::objectReturned(Activity &activity) {
  model::Instance &instance = *activity.instance;
  if (activity.found) instance.useHint = false;
  /* A destroy may have marked the instance already, and its section not have ended. */
  const bool ends = std::any_of(activities_.begin(), activities_.end(), [&](const Activity &other) {
    return other.kind == Activity::Destroy && other.instance == &instance;
  });
  if (activity.tracked || activity.mayStay || instance.destroyed || ends) return;
  host::panic("lockstep: an object's call has changed nothing where it should have");
}

/* ---- What clients see ------------------------------------------------------------------------ */

model::Instance &Lockstep::instanceOf(const void *real) {
  for (Known *known : alive_)
    if (known->real == real) return *known;
  /* Destroyed, with its last calls to come; the newest, since memory is used again. */
  for (auto known = instances_.rbegin(); known != instances_.rend(); ++known)
    if (known->real == real) return *known;
  host::panic("lockstep: a call for an instance that nobody knows");
}

size_t Lockstep::saw(model::Instance &instance, size_t from, const model::Answer &answer) {
  const auto begin = instance.answers.begin() + static_cast<ptrdiff_t>(from);
  const auto found = std::find(begin, instance.answers.end(), answer);
  ++checks_;
  if (found != instance.answers.end()) return static_cast<size_t>(found - instance.answers.begin());
  /* Written under the instance's lock, and seen before the section that wrote it has ended. */
  known(instance).expected.push_back(answer);
  return instance.answers.size();
}

void Lockstep::answersGrew() {
  for (Known *known : alive_) {
    const std::vector<model::Answer> &answers = known->answers;
    if (answers.size() == known->answersCounted) continue;
    counts_.answers += answers.size() - known->answersCounted;
    known->answersCounted = answers.size();
    for (const model::Answer &one : known->expected)
      if (one != answers.back())
        host::panic(
            "lockstep: a client saw \"%s\", which the instance never had; it now has \"%s\"",
            one.text().c_str(), answers.back().text().c_str());
    known->expected.clear();
  }
}

/* ---- Comparison ------------------------------------------------------------------------------ */

/* Where every access is watched, everything after each section. Else what the section has touched,
 * and everything at every sixteenth, or later where much is held, so that this takes no longer than
 * the sections themselves: what was written to where it does not belong is found a little later, and
 * many more sections are played. */
void Lockstep::compareSection() {
  ++checks_;
  const size_t held = model_->nodes.size() + model_->netIfs.size();
  const size_t touched = model_->touchedNodes.size() + model_->touchedNetIfs.size();
  if (sim::access::watching || ++sectionsSinceWhole_ >= std::max<size_t>(16, held / 4) ||
      touched > held / 4 + 8) {
    compareWhole();
  } else {
    compareTouched();
  }
  model_->touchedNodes.clear();
  model_->touchedNetIfs.clear();
}

/* With the lists that they are on: of the long ones, which all share, both ends. */
void Lockstep::compareTouched() {
  const zel_UUID cache{};
  require<int>(cache_->enabled, model_->enabled, "enabled", cache);
  require<size_t>(cache_->nodeTree->data->count, model_->nodes.size(), "nodes", cache);
  for (model::Node *node : model_->touchedNodes) compareNode(*node, realOf(*node));
  for (model::NetIf *netIf : model_->touchedNetIfs)
    if (netIf->node) compareNetIf(*netIf, realOf(*netIf));
  requireEnds<KARSTResolverNetIf>(model_->netIfs, cache_->netIfs,
                                  offsetof(KARSTResolverNetIf, cacheLinks), "interface");
  requireEnds<KARSTResolverNode>(model_->dirty, cache_->dirtyNodes,
                                 offsetof(KARSTResolverNode, dirtyLinks), "dirty node");
}

void Lockstep::compareWhole() {
  sectionsSinceWhole_ = 0;
  const zel_UUID cache{};
  require<int>(cache_->enabled, model_->enabled, "enabled", cache);
  size_t inUse = 0;
  for (const KARSTResolverNode &real : std::span(cache_->nodePool, KARST_RESOLVER_NODE_POOL_SIZE)) {
    if (!isTagged(real, KARST_RESOLVER_TAG_NODE)) continue;
    ++inUse;
    const auto found = model_->nodes.find(real.uuid);
    if (found == model_->nodes.end())
      host::panic("lockstep: node %s is cached and should not be", name(real.uuid).c_str());
    compareNode(*found->second, real);
  }
  require(inUse, model_->nodes.size(), "nodes", cache);

  compareList<KARSTResolverNetIf>(
      model_->netIfs, cache_->netIfs, offsetof(KARSTResolverNetIf, cacheLinks), "interfaces", cache,
      [&](model::NetIf &netIf, KARSTResolverNetIf &real) { compareNetIf(netIf, real); });
  compareList<KARSTResolverNode>(model_->dirty, cache_->dirtyNodes,
                                 offsetof(KARSTResolverNode, dirtyLinks), "dirty nodes", cache,
                                 requireAt<model::Node, KARSTResolverNode>);
}

/* A new one is looked for: any slot may be its. */
const KARSTResolverNode &Lockstep::realOf(const model::Node &node) const {
  if (node.slot) return *static_cast<const KARSTResolverNode *>(node.slot);
  for (const KARSTResolverNode &real : std::span(cache_->nodePool, KARST_RESOLVER_NODE_POOL_SIZE))
    if (real.uuid == node.uuid && isTagged(real, KARST_RESOLVER_TAG_NODE)) return real;
  host::panic("lockstep: node %s is not cached and should be", name(node.uuid).c_str());
}

/* A new one stands at the end. */
const KARSTResolverNetIf &Lockstep::realOf(const model::NetIf &netIf) const {
  if (netIf.slot) return *static_cast<const KARSTResolverNetIf *>(netIf.slot);
  for (const KARSTResolverLink *link = cache_->netIfs.previous; link != &cache_->netIfs;
       link = link->previous) {
    const auto &real = *KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, cacheLinks);
    if (real.uuid == netIf.uuid && real.node && isAt(*netIf.node, *real.node)) return real;
  }
  host::panic("lockstep: interface %s is not cached and should be", name(netIf.uuid).c_str());
}

void Lockstep::compareNode(model::Node &node, const KARSTResolverNode &real) {
  const zel_UUID &uuid = node.uuid;
  if (!node.slot) node.slot = &real;
  if (node.slot != &real || real.uuid != uuid || !isTagged(real, KARST_RESOLVER_TAG_NODE))
    host::panic("lockstep: node %s is not where it was", name(uuid).c_str());
  require<unsigned>(real.refCount, node.references, "references", uuid);
  require<int>(real.reachable, node.reachable, "reachable", uuid);
  require<int>(real.isSelf, node.self, "isSelf", uuid);
  require<int>(real.isWitness, node.witness, "isWitness", uuid);
  require<int>(real.rescanSeen, 0, "rescanSeen", uuid);
  require<int>(real.dirtyLinks.next != nullptr, node.dirty, "dirty", uuid);
  require(real.majorVersion, node.major, "majorVersion", uuid);
  require(real.minorVersion, node.minor, "minorVersion", uuid);
  compareList<KARSTResolverNetIf>(node.netIfs, real.netIfList,
                                  offsetof(KARSTResolverNetIf, nodeLinks), "interfaces", uuid,
                                  requireAt<model::NetIf, KARSTResolverNetIf>);
  compareList<KARSTResolverInstance>(node.instances, real.instanceList,
                                     offsetof(KARSTResolverInstance, nodeLinks), "instances", uuid,
                                     [](model::Instance &instance, KARSTResolverInstance &own) {
                                       compareInstance(known(instance), own);
                                     });
  if (!node.set.is(node.set.state, real.locators))
    host::panic("lockstep: the locators of %s are \"%s\", and should be \"%s\"", name(uuid).c_str(),
                model::Answer::of(node.set.state, real.locators).text().c_str(),
                node.set.text().c_str());
}

void Lockstep::compareNetIf(model::NetIf &netIf, const KARSTResolverNetIf &real) {
  const zel_UUID &uuid = netIf.uuid;
  if (!netIf.slot) netIf.slot = &real;
  if (netIf.slot != &real || real.uuid != uuid)
    host::panic("lockstep: interface %s is out of order", name(uuid).c_str());
  if (!real.node || !isAt(*netIf.node, *real.node))
    host::panic("lockstep: interface %s has another owner", name(uuid).c_str());
  require<unsigned>(real.refCount, netIf.references, "references", uuid);
  require<int>(real.healthy, netIf.healthy, "healthy", uuid);
  require<int>(real.healthSubInstalled, netIf.watched, "healthSubInstalled", uuid);
  require<int>(real.rescanSeen, 0, "rescanSeen", uuid);
  require(real.health.healthFlags, netIf.health.healthFlags, "healthFlags", uuid);
  if (std::memcmp(&real.info, &netIf.info, sizeof real.info) != 0)
    host::panic("lockstep: the record of interface %s differs", name(uuid).c_str());
}

void Lockstep::compareInstance(Known &instance, KARSTResolverInstance &real) {
  if (!instance.real) instance.real = &real; /* its first attachment */
  if (instance.real != &real) host::panic("lockstep: a node's instances are out of order");
  require<int>(real.nodeChanged, instance.changed, "nodeChanged", instance.bound);
  if (real.boundNodeUUID != instance.bound || real.node->uuid != instance.node->uuid)
    host::panic("lockstep: an instance is bound elsewhere");
  requireAnswer(instance);
}

void Lockstep::requireAnswer(const Known &instance) KARST_UNCHECKED {
  const KARSTResolverInstance &real = *instance.real;
  if (!instance.answer().is(real.state, real.locators))
    host::panic("lockstep: an instance answers \"%s\", and should \"%s\"",
                model::Answer::of(real.state, real.locators).text().c_str(),
                instance.answer().text().c_str());
}

/* ---- At rest --------------------------------------------------------------------------------- */

void Lockstep::atRest() {
  for (const Activity &activity : activities_)
    if (activity.kind != Activity::World)
      host::panic("lockstep: a fiber is still inside the module");
  if (!cache_) return;
  compareWhole();
  const zel_UUID cache{};
  for (const Known &known : instances_)
    if (!known.expected.empty())
      host::panic("lockstep: a client saw \"%s\", which the instance never had",
                  known.expected.front().text().c_str());
  for (const Known *known : alive_) {
    requireAnswer(*known);
    require<uint64_t>(known->real->refCount, host::isZero(known->object) ? 1 : 2,
                      "references of an instance", known->bound);
  }
  require<uint64_t>(cache_->refCount, cacheSubscriptions_ + model_->followed.size() + alive_.size(),
                    "references of the cache", cache);
  const std::span slots(cache_->netIfPool, KARST_RESOLVER_NETIF_POOL_SIZE);
  const auto inUse = std::count_if(slots.begin(), slots.end(), [](const auto &slot) {
    return isTagged(slot, KARST_RESOLVER_TAG_NETIF);
  });
  require(static_cast<size_t>(inUse), model_->slots.size(), "slots of interfaces", cache);
  if (!model_->enabled) return;
  if (!model_->dirty.empty())
    host::panic("lockstep: node %s is dirty and nobody works on it",
                name(model_->dirty.front()->uuid).c_str());
}
