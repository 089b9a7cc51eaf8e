/* The sequential resolver; see model.h. */
#include "tests/scenarios/model.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstring>
#include <utility>

#include "host/kernel/panic.h"

namespace model {

/* ---- Answers --------------------------------------------------------------------------------- */

void Answer::add(uint32_t type, const uint8_t *address) {
  if (count == locators.size()) return;
  Locator &locator = locators[count++];
  locator.type = type;
  if (type != KARST_RESOLVER_LOCATOR_LOCAL)
    std::memcpy(locator.address.data(), address, type == KARST_RESOLVER_LOCATOR_IPV6 ? 16 : 4);
}

Answer Answer::of(uint32_t state, const KARSTResolverNodeLocators &set) {
  Answer answer{state, set.nodeUUID, set.majorVersion, set.minorVersion, set.trafficType};
  for (uint16_t i = 0; i < set.count; i++)
    answer.add(set.locators[i].networkType, set.locators[i].address);
  return answer;
}

std::string Answer::text() const {
  std::string text = fmt::format("state {}, node {}, version {}.{}, traffic {},", state,
                                 host::toString(node), major, minor, trafficType);
  for (size_t i = 0; i < count; i++)
    text += fmt::format(" {}:{:02x}", locators[i].type, fmt::join(locators[i].address, ""));
  return text;
}

/* ---- Inputs ---------------------------------------------------------------------------------- */

Input Inputs::take(Input::Kind kind, uint8_t type, const zel_UUID &uuid) {
  const auto question = [](int asked, int about, const zel_UUID &entry) {
    return fmt::format("kind {}, type {}, {}", asked, about, host::toString(entry));
  };
  if (empty())
    host::panic("model: the module did not ask for %s", question(kind, type, uuid).c_str());
  Input input = std::move(queue_[taken_++]);
  if (empty()) {
    queue_.clear();
    taken_ = 0;
  }
  if (input.kind != kind || input.type != type || input.uuid != uuid)
    host::panic("model: the module asked for %s in place of %s",
                question(input.kind, input.type, input.uuid).c_str(),
                question(kind, type, uuid).c_str());
  return input;
}

/* ---- Nodes ----------------------------------------------------------------------------------- */

Node *Resolver::find(const zel_UUID &uuid) {
  const auto found = nodes.find(uuid);
  if (found == nodes.end()) return nullptr;
  return found->second.get();
}

Node *Resolver::findOrCreate(const zel_UUID &uuid) {
  if (!enabled) return nullptr;
  if (Node *node = find(uuid)) return node;
  if (nodes.size() == mostNodes) {
    refused = true;
    return nullptr;
  }
  auto node = std::make_unique<Node>();
  node->uuid = uuid;
  node->self = uuid == self;
  return (nodes[uuid] = std::move(node)).get();
}

void Resolver::mark(Node &node) {
  if (!enabled || node.dirty) return;
  node.dirty = true;
  dirty.push_back(&node);
}

void Resolver::release(Node *node) {
  if (--node->references != 0) return;
  if (node->dirty) std::erase(dirty, node);
  nodes.erase(node->uuid);
}

void Resolver::setReachable(Node &node, bool reachable) {
  if (node.reachable == reachable) return;
  node.reachable = reachable;
  mark(node);
  if (reachable) {
    ++node.references;
  } else {
    release(&node);
  }
}

bool Resolver::updateVersion(Node &node, const KarstEntryHeader *header, Inputs &inputs) {
  const Input whole =
      inputs.take(Input::FindWhole, header ? uint8_t{0} : uint8_t{KARST_TYPE_NODE}, node.uuid);
  if (whole.status != ZEL_OK) return false;
  const Input decoded = inputs.take(Input::Decoded, KARST_TYPE_NODE, {});
  if (decoded.status != ZEL_OK) return false;
  KarstNodeEntry record;
  std::memcpy(&record, decoded.record.data(), sizeof record);
  const bool witness = (record.flags & KARST_NODE_FLAG_WITNESS) != 0;
  node.news |= !node.dirty && (node.major != record.majorVersionNum ||
                               node.minor != record.minorVersionNum || node.witness != witness);
  node.major = node.set.major = record.majorVersionNum;
  node.minor = node.set.minor = record.minorVersionNum;
  node.witness = witness;
  node.set.node = node.uuid;
  return true;
}

void Resolver::nodeFound(Node &node, const KarstEntryHeader *header, Inputs &inputs) {
  setReachable(node, true);
  if (!updateVersion(node, header, inputs)) setReachable(node, false);
}

void Resolver::nodeCall(const KarstEntryHeader &header, zel_Status status, Inputs &inputs) {
  if (status == ZEL_SUB_RESYNC || status == ZEL_SUB_OVERFLOW) return rescanNodes(inputs);
  if (status == ZEL_OK) {
    if (Node *node = findOrCreate(header.uuid)) nodeFound(*node, nullptr, inputs);
  } else if (status == ZEL_NOT_FOUND) {
    if (Node *node = find(header.uuid)) setReachable(*node, false);
  }
}

void Resolver::rescanNodes(Inputs &inputs) {
  for (;;) {
    const Input next = inputs.take(Input::Find, KARST_TYPE_NODE, {});
    if (next.status != ZEL_OK) break;
    if (Node *node = findOrCreate(next.header.uuid)) {
      node->seen = true;
      nodeFound(*node, &next.header, inputs);
    }
  }
  for (auto it = nodes.begin(); it != nodes.end();) {
    Node &node = *(it++)->second; /* first the next one: this one may go */
    if (!std::exchange(node.seen, false)) setReachable(node, false);
  }
}

/* ---- Interfaces ------------------------------------------------------------------------------ */

NetIf *Resolver::findNetIf(const zel_UUID &owner, const zel_UUID &uuid) {
  if (Node *node = find(owner))
    for (NetIf *netIf : node->netIfs) {
      if (netIf->uuid != uuid) continue;
      return netIf;
    }
  return nullptr;
}

NetIf *Resolver::findOrCreateNetIf(const zel_UUID &owner, const zel_UUID &uuid, Inputs &inputs) {
  if (!enabled) return nullptr;
  if (NetIf *netIf = findNetIf(owner, uuid)) return netIf;
  if (slots.size() == mostNetIfs) {
    refused = true;
    return nullptr;
  }
  Node *node = findOrCreate(owner);
  if (!node) return nullptr;
  auto made = std::make_unique<NetIf>();
  NetIf *netIf = made.get();
  slots[netIf] = std::move(made);
  netIf->uuid = uuid;
  netIf->node = node;
  netIfs.push_back(netIf);
  node->netIfs.push_back(netIf);
  ++node->references;
  updateHealth(*netIf, inputs);
  return netIf;
}

bool Resolver::updateNetIf(NetIf &netIf, Inputs &inputs) {
  const Input whole = inputs.take(Input::FindWhole, KARST_TYPE_NET_INTERFACE, netIf.uuid);
  if (whole.status != ZEL_OK || whole.header.owner != netIf.node->uuid) return false;
  const Input decoded = inputs.take(Input::Decoded, KARST_TYPE_NET_INTERFACE, {});
  if (decoded.status != ZEL_OK) return false;
  KarstNetInterfaceEntry info;
  std::memcpy(&info, decoded.record.data(), sizeof info);
  if (info.trafficTypeMask == 0) info.trafficTypeMask = ~uint64_t{0};
  if (std::memcmp(&info, &netIf.info, sizeof info) == 0) return true;
  netIf.info = info;
  mark(*netIf.node);
  return true;
}

void Resolver::updateHealth(NetIf &netIf, Inputs &inputs) {
  KarstHealthStatusEntry health;
  std::memset(&health, 0xff, sizeof health);
  const Input whole = inputs.take(Input::FindWhole, KARST_TYPE_HEALTH_STATUS, netIf.uuid);
  if (whole.status == ZEL_OK) {
    const Input decoded = inputs.take(Input::Decoded, KARST_TYPE_HEALTH_STATUS, {});
    std::memcpy(&health, decoded.record.data(), sizeof health);
  }
  const bool changed = health.healthFlags != netIf.health.healthFlags;
  netIf.health = health;
  netIf.healthy = health.healthFlags == 0;
  if (changed) mark(*netIf.node);
}

void Resolver::releaseNetIf(NetIf &netIf) {
  if (--netIf.references != 0) return;
  slots.erase(&netIf);
}

void Resolver::destroyNetIf(NetIf &netIf) {
  Node *node = netIf.node;
  std::erase(netIfs, &netIf);
  std::erase(node->netIfs, &netIf);
  mark(*node);
  release(node);
  netIf.node = nullptr;
  netIf.watched = false; /* the reference goes with the last call */
  releaseNetIf(netIf);
}

void Resolver::netIfCall(const KarstEntryHeader &header, zel_Status status, Inputs &inputs) {
  if (status == ZEL_SUB_RESYNC || status == ZEL_SUB_OVERFLOW) return rescanNetIfs(inputs);
  if (status == ZEL_OK) {
    NetIf *netIf = findOrCreateNetIf(header.owner, header.uuid, inputs);
    if (netIf && !updateNetIf(*netIf, inputs)) destroyNetIf(*netIf);
  } else if (status == ZEL_NOT_FOUND) {
    if (NetIf *netIf = findNetIf(header.owner, header.uuid)) destroyNetIf(*netIf);
  }
}

void Resolver::rescanNetIfs(Inputs &inputs) {
  for (;;) {
    const Input next = inputs.take(Input::Find, KARST_TYPE_NET_INTERFACE, {});
    if (next.status != ZEL_OK) break;
    NetIf *netIf = findOrCreateNetIf(next.header.owner, next.header.uuid, inputs);
    if (!netIf) continue;
    if (updateNetIf(*netIf, inputs)) {
      netIf->seen = true;
    } else {
      destroyNetIf(*netIf);
    }
  }
  const std::vector<NetIf *> all = netIfs;
  for (NetIf *netIf : all)
    if (!std::exchange(netIf->seen, false)) destroyNetIf(*netIf);
}

void Resolver::healthCall(const void *data, zel_Status status, Inputs &inputs) {
  const auto found = followed.find(data);
  if (found == followed.end()) host::panic("model: a health call for an interface that is gone");
  NetIf &netIf = *found->second;
  if (status == ZEL_SUB_CANCELLED) {
    followed.erase(found);
    releaseNetIf(netIf);
  } else if (netIf.node) {
    updateHealth(netIf, inputs);
  }
}

/* ---- Locators -------------------------------------------------------------------------------- */

void Resolver::generate(Node &node) {
  Answer &set = node.set;
  node.news = false;
  set = {.node = node.uuid, .major = node.major, .minor = node.minor};
  set.trafficType = witness_ || node.witness ? 1 : 0;
  for (const NetIf *netIf : node.netIfs) {
    const KarstNetInterfaceEntry &info = netIf->info;
    if (!netIf->healthy || !(info.trafficTypeMask >> set.trafficType & 1)) continue;
    if (info.networkType != KARST_NETWORK_TYPE_IP) continue;
    const uint8_t *single = info.ipv4Address;
    if (info.numIpAddresses == 0 && (single[0] | single[1] | single[2] | single[3]))
      set.add(KARST_RESOLVER_LOCATOR_IPV4, single);
    for (uint32_t i = 0; i < std::min(info.numIpAddresses, 7u); i++) {
      const KarstIpAddress &address = info.ipAddresses[i];
      set.add(address.isIPv6 ? KARST_RESOLVER_LOCATOR_IPV6 : KARST_RESOLVER_LOCATOR_IPV4,
              address.address);
    }
  }
}

void Resolver::updateAnswer(Instance &instance) {
  const Node *node = instance.node;
  Answer answer{.state = KARST_RESOLVER_STATE_UNRESOLVED};
  if (node && instance.local && node->self) {
    answer = {KARST_RESOLVER_STATE_RESOLVED, node->uuid, node->major, node->minor};
    answer.add(KARST_RESOLVER_LOCATOR_LOCAL, nullptr);
  } else if (node && node->reachable && node->set.count > 0) {
    answer = node->set;
    answer.state = KARST_RESOLVER_STATE_RESOLVED;
  }
  instance.answers.push_back(answer);
}

/* ---- The world ------------------------------------------------------------------------------- */

void Resolver::installHealth(Inputs &inputs) {
  for (NetIf *netIf : netIfs) {
    if (netIf->watched) continue;
    const Input made = inputs.take(Input::Subscribed, KARST_TYPE_HEALTH_STATUS, netIf->uuid);
    if (made.status != ZEL_OK) continue;
    netIf->watched = true;
    followed[made.data] = netIf;
    ++netIf->references;
  }
}

void Resolver::workOff(Inputs &inputs) {
  for (;;) {
    if (inputs.take(Input::Preemption, 0, {}).status != 0 || dirty.empty()) {
      stage_ = Stage::Cycle;
      return;
    }
    Node *node = dirty.front();
    dirty.pop_front();
    node->dirty = false;
    generate(*node);
    if (node->instances.empty()) continue;
    ++node->references;
    refreshing = node;
    pending = std::exchange(node->instances, {});
    current_ = pending.front();
    stage_ = Stage::Refresh;
    return;
  }
}

void Resolver::worldSection(Inputs &inputs) {
  switch (stage_) {
    case Stage::Cycle:
      installHealth(inputs);
      workOff(inputs);
      return;
    case Stage::Refresh:
      if (current_->node == refreshing) updateAnswer(*current_);
      stage_ = Stage::Resume;
      return;
    case Stage::Resume:
      if (current_->node == refreshing) {
        std::erase(pending, current_);
        std::erase(refreshing->instances, current_);
        refreshing->instances.insert(refreshing->instances.begin(), current_);
      }
      if (!pending.empty()) {
        current_ = pending.front();
        stage_ = Stage::Refresh;
        return;
      }
      release(std::exchange(refreshing, nullptr));
      current_ = nullptr;
      workOff(inputs);
  }
}

void Resolver::worldEnds() {
  if (stage_ != Stage::Cycle) host::panic("model: the world ends while it refreshes instances");
}

/* ---- Instances ------------------------------------------------------------------------------- */

bool Resolver::tracksAlready(const Instance &instance, const zel_UUID &uuid) {
  if (instance.changed) return true;
  return instance.node ? instance.node->uuid == uuid : host::isZero(uuid);
}

void Resolver::leave(Instance &instance) {
  std::erase(pending, &instance);
  std::erase(instance.node->instances, &instance);
  release(std::exchange(instance.node, nullptr));
}

void Resolver::track(Instance &instance, const zel_UUID &uuid) {
  if (instance.destroyed) return;
  bool attach = false;
  if (!host::isZero(uuid)) {
    attach = host::isZero(instance.bound) || instance.bound == uuid;
    instance.changed |= !attach;
  }
  if (instance.node) leave(instance);
  if (attach) {
    if (Node *node = findOrCreate(uuid)) {
      node->instances.insert(node->instances.begin(), &instance);
      ++node->references;
      instance.node = node;
      instance.bound = uuid;
    }
  }
  updateAnswer(instance);
}

void Resolver::destroy(Instance &instance) {
  instance.destroyed = true;
  if (instance.node) leave(instance);
}

/* ---- Enable, disable ------------------------------------------------------------------------- */

void Resolver::learnSelf(Inputs &inputs) {
  self = inputs.take(Input::Self, 0, {}).header.uuid;
  for (auto &[uuid, node] : nodes) node->self = uuid == self;
}

void Resolver::forgetEntries() {
  for (auto it = nodes.begin(); it != nodes.end();) {
    Node &node = *(it++)->second;
    setReachable(node, false);
  }
  const std::vector<NetIf *> all = netIfs;
  for (NetIf *netIf : all) destroyNetIf(*netIf);
}

}  // namespace model
