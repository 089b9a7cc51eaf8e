/* Follows the way of the resolver from entry to address, and says where it ends. No lock. */
#include "cli/diagnosis.h"

#include <algorithm>
#include <vector>

#include "host/directory/records.h"
#include "host/kernel/text.h"

namespace cli {
namespace {

/* What the resolver has room for. */
constexpr size_t kCachedNodes = 128;
constexpr size_t kCachedInterfaces = 512;

/* How far an interface gets on its way to being an answer. */
enum class Stage {
  Undecodable,
  NoHealthEntry,
  Unhealthy,
  OtherTraffic,
  UnknownNetwork,
  NoAddress,
  Good
};

struct Finding {
  Stage stage;
  std::string text; /* with a plural of its own: follows a number */
};

Finding judgeHealth(const host::Directory &directory, const zel_UUID &interface) {
  const auto entry = directory.entry(KARST_TYPE_HEALTH_STATUS, interface);
  if (!entry) return {Stage::NoHealthEntry, "without health entry"};
  KarstHealthStatusEntry health{};
  /* Of a health record that cannot be decoded wholly, what was read before that point counts. */
  const zel_Status status = host::decode(entry->data, &health);
  if (health.healthFlags == 0) return {Stage::Good, ""};
  if (status != ZEL_OK) {
    return {Stage::Unhealthy, host::formatText("with a health entry that cannot be decoded (%s)",
                                               host::statusText(status))};
  }
  return {Stage::Unhealthy, "unhealthy"};
}

bool hasAddress(const KarstNetInterfaceEntry &record) {
  static constexpr uint8_t none[4] = {};
  return record.numIpAddresses != 0 || !std::equal(none, none + 4, record.ipv4Address);
}

Finding judgeInterface(const host::Directory &directory, const host::Entry &entry,
                       unsigned trafficType) {
  KarstNetInterfaceEntry record{};
  const zel_Status status = host::decode(entry.data, &record);
  if (status != ZEL_OK) {
    return {Stage::Undecodable, host::formatText("undecodable (%s)", host::statusText(status))};
  }
  Finding health = judgeHealth(directory, entry.uuid);
  if (health.stage != Stage::Good) return health;
  if (record.trafficTypeMask != 0 && (record.trafficTypeMask >> trafficType & 1) == 0) {
    return {Stage::OtherTraffic, "for other traffic"};
  }
  if (record.networkType != KARST_NETWORK_TYPE_IP) {
    return {Stage::UnknownNetwork,
            host::formatText("of unknown network type %u", record.networkType)};
  }
  if (!hasAddress(record)) return {Stage::NoAddress, "without an address"};
  return {Stage::Good, ""};
}

/* What the interface that got furthest lacks, said of all of them. */
std::string headline(Stage furthest, unsigned trafficType) {
  switch (furthest) {
    case Stage::Undecodable:
      return "no interface whose entry can be decoded";
    case Stage::NoHealthEntry:
    case Stage::Unhealthy:
      return "no healthy interface";
    case Stage::OtherTraffic:
      return host::formatText("no healthy interface carries traffic type %u", trafficType);
    case Stage::UnknownNetwork:
      return "no healthy interface of a known network type";
    case Stage::NoAddress:
    case Stage::Good:
      break;
  }
  return "no healthy interface with an address";
}

/* "2 unhealthy, 1 without health entry", in the order of first appearance. */
std::string tally(const std::vector<Finding> &findings) {
  std::vector<std::pair<std::string, size_t>> counts;
  for (const Finding &finding : findings) {
    const auto same = std::find_if(counts.begin(), counts.end(),
                                   [&](const auto &count) { return count.first == finding.text; });
    if (same == counts.end()) {
      counts.emplace_back(finding.text, 1);
    } else {
      same->second++;
    }
  }
  std::string text;
  for (const auto &[kind, count] : counts) {
    text += (text.empty() ? "" : ", ") + std::to_string(count) + " " + kind;
  }
  return text;
}

/* Entries beyond the resolver's room are left out by it. */
std::optional<std::string> whyLeftOut(const host::Directory &directory) {
  const size_t nodes = directory.entries(KARST_TYPE_NODE).size();
  const size_t interfaces = directory.entries(KARST_TYPE_NET_INTERFACE).size();
  if (nodes > kCachedNodes) {
    return host::formatText("the resolver is full: it knows %zu nodes, the directory has %zu",
                            kCachedNodes, nodes);
  }
  if (interfaces > kCachedInterfaces) {
    return host::formatText("the resolver is full: it knows %zu interfaces, the directory has %zu",
                            kCachedInterfaces, interfaces);
  }
  return {};
}

std::optional<std::string> whyNodeUnresolved(const Viewpoint &view, const zel_UUID &uuid) {
  const auto entry = view.directory.entry(KARST_TYPE_NODE, uuid);
  if (!entry) return "no entry for the node";
  KarstNodeEntry node{};
  const zel_Status status = host::decode(entry->data, &node);
  if (status != ZEL_OK) {
    return host::formatText("the node's entry cannot be decoded (%s)", host::statusText(status));
  }
  const unsigned trafficType = view.witness || (node.flags & KARST_NODE_FLAG_WITNESS) != 0 ? 1 : 0;

  std::vector<Finding> findings;
  Stage furthest = Stage::Undecodable;
  for (const host::Entry &interface : view.directory.entries(KARST_TYPE_NET_INTERFACE)) {
    if (interface.owner != uuid) continue;
    findings.push_back(judgeInterface(view.directory, interface, trafficType));
    furthest = std::max(furthest, findings.back().stage);
  }
  if (findings.empty()) return "the node has no interface";
  if (furthest == Stage::Good) return whyLeftOut(view.directory);
  return headline(furthest, trafficType) + " (" + tally(findings) + ")";
}

/* The node's own reason, said of the node that stands in for the object. */
std::optional<std::string> whyVia(const Viewpoint &view, const char *role, const zel_UUID &node) {
  const auto reason = whyNodeUnresolved(view, node);
  if (!reason) return {};
  return std::string(role) + " " + nameOrUUID(view.names, node) + ": " + *reason;
}

std::optional<std::string> whyObjectUnresolved(const Viewpoint &view, const Target &object,
                                               const std::optional<zel_UUID> &boundNode) {
  const auto entry = view.directory.entry(object.type, object.uuid);
  if (!entry) {
    if (host::isZero(object.hint)) return "no entry for the object";
    const auto hinted = whyVia(view, "hinted node", object.hint);
    if (!hinted) return {};
    return "no entry for the object; " + *hinted;
  }
  if (host::isZero(entry->owner)) return "the object's entry names no owner";
  if (boundNode && *boundNode != entry->owner) {
    return "its owner changed from " + nameOrUUID(view.names, *boundNode) + " to " +
           nameOrUUID(view.names, entry->owner);
  }
  return whyVia(view, "owner", entry->owner);
}

}  // namespace

std::optional<std::string> whyUnresolved(const Viewpoint &view, const Target &target,
                                         const std::optional<zel_UUID> &boundNode) {
  return target.isObject ? whyObjectUnresolved(view, target, boundNode)
                         : whyNodeUnresolved(view, target.uuid);
}

}  // namespace cli
