/* The model beside the module; see lockstep.h. Every member of the module that is read here is read
 * where its lock is held or nothing runs.
 */
#include "tests/scenarios/lockstep.h"

#include <algorithm>
#include <cstring>
#include <span>

#include "host/kernel/panic.h"
#include "host/kernel/uuid.h"
#include "sim/access/access.h"
#include "tests/scenarios/guards.h"

using model::Input;

namespace {

/* By the name of its layout: the type of a record, and its size. */
std::pair<uint8_t, size_t> kindOf(const std::string_view record) {
  if (record == "KarstNodeEntry") return {KARST_TYPE_NODE, sizeof(KarstNodeEntry)};
  if (record == "KarstNetInterfaceEntry")
    return {KARST_TYPE_NET_INTERFACE, sizeof(KarstNetInterfaceEntry)};
  return {KARST_TYPE_HEALTH_STATUS, sizeof(KarstHealthStatusEntry)};
}

void require(uint64_t real, uint64_t wanted, const char *what, const zel_UUID &whose = {}) {
  if (real == wanted) return;
  host::panic("lockstep: %s%s is %llu, and should be %llu", what,
              host::isZero(whose) ? "" : (" of " + host::toString(whose)).c_str(),
              static_cast<unsigned long long>(real), static_cast<unsigned long long>(wanted));
}

void requireAnswer(const model::Answer &wanted, uint32_t state,
                   const KARSTResolverNodeLocators &set, const zel_UUID &node) {
  const model::Answer real = model::Answer::of(state, set);
  if (real != wanted)
    host::panic("lockstep: %s answers \"%s\", and should \"%s\"", host::toString(node).c_str(),
                real.text().c_str(), wanted.text().c_str());
}

/* Each on a list beside the one that it should be. `links`: where an element has its own. */
template <typename Real, typename Wanted, typename Compare>
void compareList(const Wanted &wanted, const KARSTResolverLink &head, size_t links,
                 const char *what, const zel_UUID &whose, Compare compare) {
  size_t length = 0;
  for (KARSTResolverLink *link = head.next; link != &head && length <= wanted.size();
       link = link->next) {
    if (length < wanted.size())
      compare(*wanted[length],
              *reinterpret_cast<Real *>(reinterpret_cast<uint8_t *>(link) - links));
    ++length;
  }
  require(length, wanted.size(), what, whose);
}

/* Where the order is all that counts. */
const auto sameUUID = [](const auto &element, const auto &slot) {
  if (element.uuid != slot.uuid)
    host::panic("lockstep: %s stands on a list where %s should", host::toString(slot.uuid).c_str(),
                host::toString(element.uuid).c_str());
};

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
  begin(Activity::Disable);
}

void Lockstep::moduleIsGone() {
  end();
  require(activities_.size(), 0, "the number of fibers inside a module that is gone");
  require(alive_.size(), 0, "the number of instances of a module that is gone");
  require(cacheSubscriptions_, 0, "the number of subscriptions of a module that is gone");
  if (model_)
    require(model_->nodes.size() + model_->slots.size(), 0,
            "the number of entries of a module that is gone");
  cache_ = nullptr;
  model_.reset();
}

void Lockstep::moduleIsThere() {
  end();
}

/* ---- What fibers do -------------------------------------------------------------------------- */

uint32_t Lockstep::fiber() const {
  return simulation_.scheduler().running().id();
}

Lockstep::Activity &Lockstep::begin(Activity::Kind kind) {
  end();
  return activities_.emplace_back(Activity{.fiber = fiber(), .kind = kind});
}

/* A world begins by itself. */
Lockstep::Activity &Lockstep::current() {
  for (Activity &activity : activities_)
    if (activity.fiber == fiber()) return activity;
  const sim::Fiber &running = simulation_.scheduler().running();
  if (running.world) return begin(Activity::World);
  host::panic("lockstep: %s is in the module for no reason that is known", running.name().c_str());
}

void Lockstep::end() {
  std::erase_if(activities_, [&](const Activity &one) { return one.fiber == fiber(); });
}

void Lockstep::subscriptionCalls(sim::Fiber &, const sim::SubscriptionCall &call) {
  const Activity::Kind kind = call.type == KARST_TYPE_NODE            ? Activity::Nodes
                              : call.type == KARST_TYPE_NET_INTERFACE ? Activity::NetIfs
                              : call.type == KARST_TYPE_HEALTH_STATUS ? Activity::Health
                                                                      : Activity::Object;
  Activity &activity = begin(kind);
  activity.call = call;
  if (kind != Activity::Object || call.status == ZEL_SUB_CANCELLED) return;
  activity.instance = &instanceOf(call.data);
  if (call.status == ZEL_OK) {
    activity.found = true;
    want(activity, call.header->owner);
  }
}

void Lockstep::subscriptionReturned(sim::Fiber &, const sim::SubscriptionCall &call) {
  Activity &activity = current();
  const bool cancelled = call.status == ZEL_SUB_CANCELLED;
  switch (activity.kind) {
    case Activity::Nodes:
    case Activity::NetIfs:
      if (cancelled) --cacheSubscriptions_;
      require(activity.sections, cancelled ? 0 : 1, "the number of sections in a call");
      break;
    case Activity::Health:
      require(activity.sections, 1, "the number of sections in a call");
      break;
    default:
      if (!cancelled) objectReturned(activity);
  }
  end();
}

void Lockstep::statusCalls(sim::Fiber &, uint32_t status) {
  begin(status & KARST_STATUS_USABLE ? Activity::Enable : Activity::Disable);
}

void Lockstep::statusReturned(sim::Fiber &, uint32_t) {
  const Activity &activity = current();
  const bool enabling = activity.kind == Activity::Enable && !activity.failed;
  if (enabling ? activity.sections != 2 : activity.disabling == 1)
    host::panic("lockstep: a status call has ended half-way");
  end();
}

model::Instance &Lockstep::creating(const zel_UUID &object, const zel_UUID &node, bool local) {
  Known &instance = instances_.emplace_back();
  alive_.push_back(&instance);
  instance.object = object;
  instance.local = local;
  Activity &activity = begin(Activity::Create);
  activity.instance = &instance;
  if (host::isZero(object)) {
    activity.wanted = node;
  } else {
    instance.hint = node;
    instance.useHint = !host::isZero(node);
  }
  return instance;
}

void Lockstep::created(zel_Status status, KARSTResolverInstance *real) {
  const Activity &activity = current();
  Known &made = known(*activity.instance);
  const bool good = status == ZEL_OK ? !made.destroyed && !activity.failed
                                     : made.destroyed || activity.sections == 0;
  if (!good)
    host::panic("lockstep: create returned 0x%x after %u sections, destroyed %d", status,
                activity.sections, made.destroyed);
  made.real = real;
  if (status == ZEL_OK) requireResolved(made);
  if (status != ZEL_OK) std::erase(alive_, &made);
  end();
}

/* At some time since its first tracking; perhaps by a section that has not ended. */
void Lockstep::requireResolved(Known &made) {
  for (const model::Answer &one : made.answers)
    if (one.state == KARST_RESOLVER_STATE_RESOLVED) return;
  if (made.real->state != KARST_RESOLVER_STATE_RESOLVED)
    host::panic("lockstep: create succeeded, and the instance never was resolved");
  made.expected.push_back(model::Answer::of(made.real->state, made.real->locators));
}

void Lockstep::destroying(model::Instance &instance) {
  begin(Activity::Destroy).instance = &instance;
}

void Lockstep::destroyed() {
  Activity &activity = current();
  require(activity.sections, 1, "the number of sections in a destroy");
  std::erase(alive_, &known(*activity.instance));
  end();
}

/* ---- What the platform answers --------------------------------------------------------------- */

void Lockstep::lookedUp(sim::Fiber &, const sim::Lookup &lookup) {
  Activity &activity = current();
  const KarstEntryHeader header = lookup.header ? *lookup.header : KarstEntryHeader{};
  if (const model::Instance *instance = activity.instance) { /* the object's entry */
    activity.found = lookup.status == ZEL_OK;
    const zel_UUID hint = instance->useHint ? instance->hint : zel_UUID{};
    return want(activity, activity.found ? header.owner : hint);
  }
  const bool next = lookup.call == sim::Call::KARST_FindEntry;
  activity.inputs.add({.kind = next ? Input::Find : Input::FindWhole,
                       .type = lookup.type,
                       .uuid = lookup.uuid,
                       .status = lookup.status,
                       .header = header});
}

void Lockstep::decoded(sim::Fiber &, const char *record, zel_Status status, const void *content) {
  const auto [type, size] = kindOf(record);
  const auto *bytes = static_cast<const uint8_t *>(content);
  current().inputs.add(
      {.kind = Input::Decoded, .type = type, .status = status, .record = {bytes, bytes + size}});
}

void Lockstep::toldSelf(sim::Fiber &, const zel_UUID &uuid) {
  KarstEntryHeader header{};
  header.uuid = uuid;
  current().inputs.add({.kind = Input::Self, .header = header});
}

void Lockstep::subscribed(sim::Fiber &, const KarstQuery &query, void *data, zel_Status status) {
  Activity &activity = current();
  if (query.type == KARST_TYPE_HEALTH_STATUS)
    return activity.inputs.add({.kind = Input::Subscribed,
                                .type = query.type,
                                .uuid = query.uuid,
                                .status = status,
                                .data = data});
  activity.failed |= status != ZEL_OK;
  if (query.type == KARST_TYPE_NODE || query.type == KARST_TYPE_NET_INTERFACE) {
    cacheSubscriptions_ += status == ZEL_OK;
  } else { /* the object's, in a create; calls may come from here on */
    known(*activity.instance).real = static_cast<KARSTResolverInstance *>(data);
    if (activity.found) activity.instance->useHint = false;
  }
}

void Lockstep::worldCreated(sim::Fiber &, zel_Status status) {
  current().failed |= status != ZEL_OK;
}

void Lockstep::worldWaited(sim::Fiber &, zel_Status status) {
  if (status != ZEL_WORLD_STOPPING) return;
  model_->worldEnds();
  end();
}

void Lockstep::preemptionAnswered(sim::Fiber &, bool yes) {
  current().inputs.add({.kind = Input::Preemption, .status = yes});
}

/* ---- Sections -------------------------------------------------------------------------------- */

void Lockstep::unlocking(sim::Fiber &fiber, const sim::Spinlock &lock) {
  if (std::strcmp(lock.name.text, "KARSTResolverCache") != 0 || !cache_) return;
  Activity &activity = current();
  step(activity);
  ++activity.sections;
  if (!activity.inputs.empty())
    host::panic("lockstep: %s asked for more than it needs", fiber.name().c_str());
  answersGrew();
  for (Activity &other : activities_) look(other);

  /* Where every access is watched, everything is compared each time. Else after every eighth section,
   * or later where much is held, so that this takes no longer than the sections themselves: a
   * difference is found a little later, and many more sections are played. */
  const size_t held = model_->nodes.size() + model_->netIfs.size();
  if (sim::access::watching || ++sectionsSinceCompared_ >= std::max<size_t>(8, held / 4)) compare();
}

void Lockstep::step(Activity &activity) {
  switch (activity.kind) {
    case Activity::Nodes:
      return model_->nodeCall(*activity.call.header, activity.call.status, activity.inputs);
    case Activity::NetIfs:
      return model_->netIfCall(*activity.call.header, activity.call.status, activity.inputs);
    case Activity::Health:
      return model_->healthCall(activity.call.data, activity.call.status, activity.inputs);
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
  const bool stays = model::Resolver::tracksAlready(*activity.instance, *activity.wanted);
  (stays ? activity.mayStay : activity.mayMove) = true;
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
    answers_ += answers.size() - known->answersCounted;
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

void Lockstep::compare() {
  ++checks_;
  sectionsSinceCompared_ = 0;
  require(cache_->enabled, model_->enabled, "enabled");
  size_t inUse = 0;
  for (const KARSTResolverNode &real : std::span(cache_->nodePool, KARST_RESOLVER_NODE_POOL_SIZE)) {
    if (std::memcmp(real.tag, KARST_RESOLVER_TAG_NODE, sizeof real.tag) != 0) continue; /* free */
    ++inUse;
    const auto found = model_->nodes.find(real.uuid);
    if (found == model_->nodes.end())
      host::panic("lockstep: node %s is cached and should not be",
                  host::toString(real.uuid).c_str());
    compareNode(*found->second, real);
  }
  require(inUse, model_->nodes.size(), "the number of nodes");
  compareList<KARSTResolverNetIf>(model_->netIfs, cache_->netIfs,
                                  offsetof(KARSTResolverNetIf, cacheLinks),
                                  "the number of interfaces", {}, compareNetIf);
  compareList<KARSTResolverNode>(model_->dirty, cache_->dirtyNodes,
                                 offsetof(KARSTResolverNode, dirtyLinks),
                                 "the number of dirty nodes", {}, sameUUID);
}

void Lockstep::compareNode(const model::Node &node, const KARSTResolverNode &real) {
  const zel_UUID &uuid = node.uuid;
  require(real.refCount, node.references, "refCount", uuid);
  require(real.reachable, node.reachable, "reachable", uuid);
  require(real.isSelf, node.self, "isSelf", uuid);
  require(real.isWitness, node.witness, "isWitness", uuid);
  require(real.rescanSeen, 0, "rescanSeen", uuid);
  require(real.dirtyLinks.next != nullptr, node.dirty, "dirty", uuid);
  require(real.majorVersion, node.major, "majorVersion", uuid);
  require(real.minorVersion, node.minor, "minorVersion", uuid);
  compareList<KARSTResolverNetIf>(node.netIfs, real.netIfList,
                                  offsetof(KARSTResolverNetIf, nodeLinks),
                                  "the number of interfaces", uuid, sameUUID);
  compareList<KARSTResolverInstance>(node.instances, real.instanceList,
                                     offsetof(KARSTResolverInstance, nodeLinks),
                                     "the number of instances", uuid, compareInstance);
  requireAnswer(node.set, node.set.state, real.locators, uuid);
}

void Lockstep::compareNetIf(const model::NetIf &netIf, const KARSTResolverNetIf &real) {
  sameUUID(netIf, real);
  const zel_UUID &uuid = netIf.uuid;
  if (!real.node || real.node->uuid != netIf.node->uuid)
    host::panic("lockstep: interface %s has another owner", host::toString(uuid).c_str());
  require(real.refCount, netIf.references, "refCount", uuid);
  require(real.healthy, netIf.healthy, "healthy", uuid);
  require(real.healthSubInstalled, netIf.watched, "healthSubInstalled", uuid);
  require(real.rescanSeen, 0, "rescanSeen", uuid);
  require(real.health.healthFlags, netIf.health.healthFlags, "healthFlags", uuid);
  if (std::memcmp(&real.info, &netIf.info, sizeof real.info) != 0)
    host::panic("lockstep: the record of interface %s differs", host::toString(uuid).c_str());
}

void Lockstep::compareInstance(model::Instance &instance, KARSTResolverInstance &real) {
  KARSTResolverInstance *&own = known(instance).real;
  if (!own) own = &real; /* its first attachment */
  if (own != &real) host::panic("lockstep: a node's instances are out of order");
  require(real.nodeChanged, instance.changed, "nodeChanged", instance.bound);
  if (real.boundNodeUUID != instance.bound || real.node->uuid != instance.node->uuid)
    host::panic("lockstep: an instance is bound elsewhere");
  requireAnswer(instance.answer(), real.state, real.locators, instance.bound);
}

/* ---- At rest --------------------------------------------------------------------------------- */

void Lockstep::atRest() {
  for (const Activity &activity : activities_)
    if (activity.kind != Activity::World)
      host::panic("lockstep: a fiber is still inside the module");
  if (!cache_) return;
  compare();
  for (const Known &known : instances_)
    if (!known.expected.empty())
      host::panic("lockstep: a client saw \"%s\", which the instance never had",
                  known.expected.front().text().c_str());
  for (const Known *known : alive_) {
    requireAnswer(known->answer(), known->real->state, known->real->locators, known->bound);
    require(known->real->refCount, host::isZero(known->object) ? 1 : 2, "refCount of an instance",
            known->bound);
  }
  require(cache_->refCount, cacheSubscriptions_ + model_->followed.size() + alive_.size(),
          "refCount of the cache");
  if (model_->enabled) require(model_->dirty.size(), 0, "the number of nodes that wait for work");
}
