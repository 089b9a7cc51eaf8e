/* The host, its actors' operations and what must hold; see cluster.h. */
#include "tests/scenarios/cluster.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstring>
#include <utility>

#include "host/directory/records.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/tracing/tracing.h"
#include "karst_resolver/trace.h"
#include "sim/lock_order.h"
#include "tests/directory_view.h"
#include "tests/scenarios/actions.h"
#include "tests/scenarios/guards.h"
#include "tests/uuids.h"

namespace {

constexpr uint32_t nudgeNode = 200; /* comes and goes to wake the world; no scenario uses it */
constexpr uint32_t firstOfFlood = 1000;

/* A function of the module. */
#define RESOLVER(name) module_->function<decltype(KARSTResolver_##name)>("KARSTResolver_" #name)

}  // namespace

std::string textOf(const sim::Operation &operation) {
  const char *text = actionShapes[static_cast<size_t>(actionOf(operation))].text;
  return fmt::format(fmt::runtime(text), operation.a, operation.b, operation.c);
}

/* ---- Life ------------------------------------------------------------------------------------ */

Cluster::Cluster(const sim::Settings &settings, std::filesystem::path module, unsigned callbackWork)
    : simulation_(settings),
      lockstep_(simulation_),
      path_(std::move(module)),
      callbackWork_(callbackWork) {
  /* The host reports, and does not mind, what a heap or a lock domain still holds at its end. */
  const auto sink = [](const host::LogLine &line) {
    if (line.text.find("still") != std::string::npos)
      host::panic("left behind: %s", line.text.c_str());
  };
  host::setLogSink(sink, true);
  simulation_.setObserver(&lockstep_);
  simulation_.directory().setSelf(nodeUUID(1));
}

Cluster::~Cluster() {
  simulation_.setObserver(nullptr);
  host::setLogSink(nullptr, false);
}

void Cluster::load() {
  if (module_ || moving_) return;
  moving_ = true;
  gone_.take();
  lockstep_.moduleComesOrGoes();
  try {
    module_ = &simulation_.modules().load(path_);
  } catch (const host::ModuleError &) { /* of a platform call; another load may succeed */
    if (simulation_.faultsInjected() == 0) host::panic("a load fails for no reason");
  }
  moving_ = false;
  if (!module_) {
    gone_.give();
    return lockstep_.moduleIsGone();
  }
  declareVariableGuards(simulation_, *module_);
  lockstep_.moduleIsThere();
  loaded_.give();
}

/* Clients make no new instances any more; those that they have, they destroy while it lasts. */
void Cluster::unload() {
  if (!module_ || moving_) return;
  moving_ = true;
  while (creating_ > 0) simulation_.scheduler().sleep(1'000);
  simulation_.spawn("closing", [this] { destroyAll(); });
  loaded_.take();
  used_.take();
  lockstep_.moduleComesOrGoes();
  simulation_.modules().unload(*module_);
  lockstep_.moduleIsGone();
  withdrawGuards(simulation_);
  gone_.give();
  if (simulation_.callbacks().subscriptions() != 0 || simulation_.callbacks().registrations() != 0)
    host::panic("unloaded, and the directory still knows the module");
  requireTraces();
  module_ = nullptr;
  moving_ = false;
}

void Cluster::close() {
  simulation_.clearFaults();
  simulation_.spawn("unloader", [this] { unload(); });
  simulation_.run();
  if (module_) host::panic("the module is still there");
}

/* ---- Operations ------------------------------------------------------------------------------ */

void Cluster::perform(const sim::Operation &operation) {
  const auto [phase, actor, kind, a, b, c] = operation;
  const Action action = actionOf(operation);
  host::Directory &directory = simulation_.directory();
  ++performed_;
  if (simulation_.keepsHistory())
    simulation_.note("operation:", sim::Argument::text(textOf(operation).c_str()));
  switch (action) {
    case Action::PutNode:
      return putNode(a, b);
    case Action::RemoveNode:
      return directory.remove(KARST_TYPE_NODE, nodeUUID(a));
    case Action::PutNetIf:
      return putNetIf(a, b, c);
    case Action::RemoveNetIf:
      return directory.remove(KARST_TYPE_NET_INTERFACE, netIfUUID(a));
    case Action::PutHealth:
      return putHealth(a, b);
    case Action::RemoveHealth:
      return directory.remove(KARST_TYPE_HEALTH_STATUS, netIfUUID(a));
    case Action::PutObject:
      return directory.put({objectType, objectUUID(a), b == 0 ? noUUID : nodeUUID(b), {0xa0}});
    case Action::RemoveObject:
      return directory.remove(objectType, objectUUID(a));
    case Action::Garble:
      return garble(a, b);
    case Action::Resync:
      return directory.resync();
    case Action::Usable:
    case Action::Unusable:
      usable_ = action == Action::Usable;
      return directory.setUsable(usable_);
    case Action::Interrupt:
      directory.setUsable(false);
      usable_ = true;
      return directory.setUsable(true);
    case Action::Flood:
      return flood(a, b, true);
    case Action::Drain:
      return flood(a, b, false);
    case Action::Create:
      return create(a, b, c);
    case Action::SetCallback:
      return setCallback(a, b);
    case Action::Read:
      return read(a, b);
    case Action::Destroy:
      return destroy(a % places);
    case Action::Load:
      return load();
    case Action::Unload:
      return unload();
    case Action::Pause:
      return simulation_.scheduler().sleep((a + 1ull) * 100'000);
    case Action::Preempt:
      return simulation_.forcePreemption(a);
  }
}

/* ---- The directory --------------------------------------------------------------------------- */

/* Flag 4: an entry that is there is changed in place, else it goes first. */
void Cluster::putNode(uint32_t node, uint32_t flags) {
  if (!(flags & 4)) simulation_.directory().remove(KARST_TYPE_NODE, nodeUUID(node));
  const KarstNodeEntry record{++stamp_, node, flags % 4, 1, 2};
  simulation_.directory().put(
      {KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), host::encode(record)});
}

/* What the record holds: 0 to 7 addresses, every second one IPv6; a traffic mask; the type. */
void Cluster::putNetIf(uint32_t netIf, uint32_t node, uint32_t record) {
  KarstNetInterfaceEntry entry{};
  entry.networkType = record % 16 == 15 ? 2 : KARST_NETWORK_TYPE_IP;
  entry.numIpAddresses = record % 8;
  entry.trafficTypeMask = record / 16 % 4;
  entry.bandwidth = record / 64;
  const uint8_t address[16] = {static_cast<uint8_t>(10 + record % 16), static_cast<uint8_t>(node),
                               static_cast<uint8_t>(netIf), static_cast<uint8_t>(record), 6};
  if (entry.networkType == KARST_NETWORK_TYPE_IP && record % 16 != 8)
    std::memcpy(entry.ipv4Address, address, sizeof entry.ipv4Address);
  for (uint32_t i = 0; i < entry.numIpAddresses; i++) {
    entry.ipAddresses[i].isIPv6 = i % 2;
    std::memcpy(entry.ipAddresses[i].address, address, i % 2 ? 16 : 4);
    entry.ipAddresses[i].address[2] = static_cast<uint8_t>(netIf + i);
  }
  simulation_.directory().put(
      {KARST_TYPE_NET_INTERFACE, netIfUUID(netIf), nodeUUID(node), host::encode(entry)});
}

void Cluster::putHealth(uint32_t netIf, uint32_t flags) {
  KarstHealthStatusEntry entry{};
  entry.healthFlags = flags % 3;
  entry.timestamp = ++stamp_;
  simulation_.directory().put(
      {KARST_TYPE_HEALTH_STATUS, netIfUUID(netIf), noUUID, host::encode(entry)});
}

/* Bytes that no reader can make sense of, below an owner that may be there or not. */
void Cluster::garble(uint32_t which, uint32_t kind) {
  const uint8_t types[] = {KARST_TYPE_NODE, KARST_TYPE_NET_INTERFACE, KARST_TYPE_HEALTH_STATUS};
  const uint8_t type = types[kind % 3];
  const zel_UUID uuid = type == KARST_TYPE_NODE ? nodeUUID(which) : netIfUUID(which);
  simulation_.directory().put(
      {type, uuid, nodeUUID(1 + which % 3), {0x9f, static_cast<uint8_t>(++stamp_)}});
}

/* Nodes with eight interfaces each. */
void Cluster::flood(uint32_t groups, uint32_t from, bool put) {
  for (uint32_t node = firstOfFlood + from; node < firstOfFlood + from + groups; node++) {
    for (uint32_t i = node * 8; i < node * 8 + 8; i++) {
      if (put) {
        putNetIf(i, node, 1);
      } else {
        simulation_.directory().remove(KARST_TYPE_NET_INTERFACE, netIfUUID(i));
      }
    }
    if (put) {
      putNode(node, 0);
    } else {
      simulation_.directory().remove(KARST_TYPE_NODE, nodeUUID(node));
    }
  }
}

/* ---- Clients --------------------------------------------------------------------------------- */

/* Targets 0 to 7 are nodes, the others objects; of the options bit 0 gives an object a hint, bit 1
 * asks for the local locator. */
void Cluster::create(uint8_t number, uint8_t target, uint8_t options) {
  const size_t place = number % places;
  if (slots_[place] || !module_ || moving_) return;
  const bool object = target >= 8;
  const zel_UUID objectWanted = object ? objectUUID(target % 8u) : noUUID;
  const zel_UUID nodeWanted =
      object ? (options & 1 ? nodeUUID(1 + options / 4 % 4u) : noUUID) : nodeUUID(target);
  const bool local = (options & 2) != 0;

  ++creating_;
  Client &client = clients_.emplace_back();
  client.cluster = this;
  client.work = callbackWork_;
  client.model = &lockstep_.creating(objectWanted, nodeWanted, local);
  slots_[place] = &client; /* taken, though nobody can use it yet */
  client.users = 1;
  loaded_.take();
  const zel_Status status =
      RESOLVER(Create)(&client.instance, objectType, objectWanted, nodeWanted, local);
  lockstep_.created(status, client.instance);
  client.made.give();
  used_.give();
  client.users = 0;
  if (status != ZEL_OK) {
    if (client.instance) host::panic("create fails with 0x%x and leaves an instance", status);
    client.destroyed = true;
    slots_[place] = nullptr;
  }
  --creating_;
}

/* Around a call with an instance; as long as somebody is inside, nobody destroys it. */
Cluster::Client *Cluster::enter(uint8_t number, bool alone) {
  Client *client = slots_[number % places];
  if (!client || !client->instance || (alone && client->users > 0)) return nullptr;
  ++client->users;
  client->made.take();
  return client;
}

void Cluster::leave(Client &client) {
  client.used.give();
  used_.give();
  --client.users;
}

void Cluster::callback(void *data, KARSTResolverInstance *instance, uint32_t state) {
  Client &client = *static_cast<Client *>(data);
  Cluster &cluster = *client.cluster;
  sim::Fiber &fiber = cluster.simulation_.scheduler().running();
  const sim::Inside inside(fiber, sim::insideClientCallback);
  if (client.destroyed) host::panic("a callback of an instance whose destroy has returned");
  if (instance != client.instance) host::panic("a callback with somebody else's data");
  if (fiber.heldCount != 1 || std::strcmp(fiber.held[0]->name.text, "KARSTResolverInstance") != 0)
    host::panic("a callback with other locks than its instance's");
  client.lastTold = cluster.lockstep_.saw(*client.model, client.lastTold,
                                          model::Answer::of(state, instance->locators));
  ++client.callbacks;
  ++cluster.callbacks_;
  for (unsigned i = 0; i < client.work; i++) cluster.simulation_.scheduler().point();
}

/* Kind 0 takes the callback away, kind 3 sets one that takes long. */
void Cluster::setCallback(uint8_t number, uint8_t kind) {
  Client *client = enter(number, true); /* one at a time sets callbacks */
  if (!client) return;
  const uint64_t before = client->callbacks;
  client->hasCallback = kind % 4 != 0;
  client->work = kind % 4 == 3 ? callbackWork_ * 8 : callbackWork_;
  RESOLVER(SetCallback)(client->instance, client->hasCallback ? &callback : nullptr, client);
  if (client->hasCallback && client->callbacks == before)
    host::panic("a new callback was not called at once");
  leave(*client);
}

/* Kind 3 has room for one locator only. */
void Cluster::read(uint8_t number, uint8_t kind) {
  Client *client = enter(number, false);
  if (!client) return;
  KARSTResolverNodeLocators set{};
  set.capacity = kind % 4 == 3 ? 1 : KARST_RESOLVER_MAX_LOCATORS;
  const size_t from = client->model->answers.size() - 1;
  const zel_Status status = RESOLVER(GetNodeLocators)(client->instance, &set);
  if (status != ZEL_OK && status != ZEL_NOT_FOUND) host::panic("a read returns 0x%x", status);
  if (set.count > set.capacity) host::panic("a read gives more than there is room for");
  const auto state =
      status == ZEL_OK ? KARST_RESOLVER_STATE_RESOLVED : KARST_RESOLVER_STATE_UNRESOLVED;
  if (status != ZEL_OK || set.capacity == KARST_RESOLVER_MAX_LOCATORS)
    lockstep_.saw(*client->model, from, model::Answer::of(state, set));
  leave(*client);
}

void Cluster::destroy(size_t place) {
  Client *client = slots_[place];
  if (!client || !client->instance || client->users > 0) return;
  KARSTResolverInstance *instance = client->instance;
  slots_[place] = nullptr; /* from here on nobody else uses it; its callback may still run */
  client->made.take();
  client->used.take();
  lockstep_.destroying(*client->model);
  RESOLVER(Destroy)(instance);
  client->destroyed = true;
  lockstep_.destroyed();
  used_.give();
}

void Cluster::destroyAll() {
  for (size_t place = 0; place < places; place++) {
    while (slots_[place]) {
      destroy(place);
      if (slots_[place]) simulation_.scheduler().sleep(1'000);
    }
  }
}

/* ---- At rest --------------------------------------------------------------------------------- */

void Cluster::recover() {
  simulation_.clearFaults();
  host::Directory &directory = simulation_.directory();
  if (usable_) {
    directory.setUsable(false); /* an enable may have failed */
    directory.setUsable(true);
  }
  simulation_.run();
  resync();
  putNode(nudgeNode, 0);
  simulation_.run();
  directory.remove(KARST_TYPE_NODE, nodeUUID(nudgeNode));
  simulation_.run();
  faultsSeen_ = simulation_.faultsInjected();
}

void Cluster::resync() {
  simulation_.directory().resync();
  simulation_.run();
}

void Cluster::rest(bool checked) {
  simulation_.run();
  if (!checked) requireQuiet();
  if (simulation_.faultsInjected() != faultsSeen_) {
    recover();
    requireQuiet();
  }
  if (!module_) return;
  requireEnabled();
  if (lockstep_.resolver().refused) resync(); /* what found no slot then may find one now */
  touchNews();
  if (checked) return;
  requireQuiet();
  requireDirectoryTaken();
}

/* A new version alone reaches no instance before its node's next change. Here that comes, in two
 * steps, since a queue that overflows takes an entry's going and coming for nothing. */
void Cluster::touchNews() {
  host::Directory &directory = simulation_.directory();
  std::vector<host::Entry> touched;
  for (const auto &[uuid, node] : lockstep_.resolver().nodes)
    if (const auto entry = directory.entry(KARST_TYPE_NODE, uuid); entry && node->news)
      touched.push_back(*entry);
  for (const host::Entry &entry : touched) directory.remove(entry.type, entry.uuid);
  simulation_.run();
  for (const host::Entry &entry : touched) directory.put(entry);
  simulation_.run();
}

void Cluster::requireQuiet() {
  lockstep_.atRest();
  if (!module_) return;
  for (const Client *client : slots_) {
    if (!client || !client->hasCallback) continue;
    const std::vector<model::Answer> &answers = client->model->answers;
    if (answers[client->lastTold] != answers.back())
      host::panic("a client was told \"%s\" last, and reads \"%s\"",
                  answers[client->lastTold].text().c_str(), answers.back().text().c_str());
  }
  requireTraces();
}

/* The module has heard of the last change of the directory's status. */
void Cluster::requireEnabled() {
  simulation_.directory().setUsable(usable_); /* two actors may have overtaken each other */
  simulation_.run();
  if (lockstep_.resolver().enabled != usable_)
    host::panic("the directory is %susable, and the module %senabled", usable_ ? "" : "not ",
                usable_ ? "not " : "");
}

/* The module holds what the directory says, where that fits. */
void Cluster::requireDirectoryTaken() {
  const auto fits = [](size_t nodes, size_t netIfs) { return nodes <= 64 && netIfs <= 400; };
  const model::Resolver &resolver = lockstep_.resolver();
  const host::Directory &directory = simulation_.directory();
  if (!usable_ || !resolver.enabled || !fits(resolver.nodes.size(), resolver.netIfs.size()) ||
      !fits(directory.entries(KARST_TYPE_NODE).size(),
            directory.entries(KARST_TYPE_NET_INTERFACE).size()))
    return;
  std::vector<HeldInstance> held;
  for (const Client *client : slots_) {
    if (!client) continue;
    HeldInstance &one = held.emplace_back(HeldInstance{client->instance, std::nullopt});
    if (client->hasCallback) one.told = client->model->answers[client->lastTold].state;
  }
  const std::vector<std::string> differences =
      differencesOf(lockstep_.cache(), directory, held, simulation_.settings().witness);
  if (!differences.empty())
    host::panic("the module and the directory differ:\n  %s",
                fmt::format("{}", fmt::join(differences, "\n  ")).c_str());
}

/* How often an event was traced. */
#define TRACED(event) traced_[KARST_RESOLVER_TRACE_ID_##event]

/* What came and went, counted from the start, is what there is. */
void Cluster::requireTraces() {
  for (const host::TracedRecord &record : host::readTrace(traceSeen_)) {
    if (record.sequence != traceSeen_) host::panic("the trace ring is too small for this run");
    ++traceSeen_;
    ++traced_[record.id % std::size(traced_)];
    if (record.id == KARST_RESOLVER_TRACE_ID_ReleaseInstance && record.payload[1] == 1)
      ++freedInstances_;
  }
  const auto require = [&](const char *what, uint64_t counted, uint64_t wanted) {
    if (counted != wanted)
      host::panic("the trace counts %llu %s, and there were %llu",
                  static_cast<unsigned long long>(counted), what,
                  static_cast<unsigned long long>(wanted));
  };
  const bool there = lockstep_.cache() != nullptr;
  require("nodes", TRACED(AddNodeToCache) - TRACED(RemoveNodeFromCache),
          there ? lockstep_.resolver().nodes.size() : 0);
  require("interfaces", TRACED(AddNetIfToCache) - TRACED(RemoveNetIfFromCache),
          there ? lockstep_.resolver().netIfs.size() : 0);
  require("instances", TRACED(CreateInstance) - freedInstances_, lockstep_.alive());
  require("answers", TRACED(UpdateAddresses), lockstep_.answers());
  require("callbacks", TRACED(InvokeCallback), callbacks_);
}
