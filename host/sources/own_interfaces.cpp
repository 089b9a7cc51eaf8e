/* Interfaces of this machine as directory entries. No lock. */
#include "host/sources/own_interfaces.h"

#include <algorithm>
#include <cstring>
#include <tuple>

#include "host/directory/records.h"
#include "host/kernel/log.h"
#include "host/sources/machine_uuid.h"
#include "host/sources/published_entries.h"

namespace host {
namespace {

bool preferred(const OwnAddress &a, const OwnAddress &b) {
  const auto rank = [](const OwnAddress &own) { return std::tie(own.passing, own.address.isIPv6); };
  if (rank(a) != rank(b)) return rank(a) < rank(b);
  return std::memcmp(a.address.address, b.address.address, sizeof a.address.address) < 0;
}

std::vector<uint8_t> recordOf(const OwnInterface &interface,
                              const std::vector<KarstIpAddress> &addresses) {
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  std::copy(interface.mac.begin(), interface.mac.end(), record.macAddress);
  record.numIpAddresses = static_cast<uint32_t>(addresses.size());
  std::copy(addresses.begin(), addresses.end(), record.ipAddresses);
  return encode(record);
}

}  // namespace

bool OwnAddress::operator==(const OwnAddress &other) const {
  return std::memcmp(&address, &other.address, sizeof address) == 0 && local == other.local &&
         passing == other.passing;
}

std::vector<KarstIpAddress> publishedAddresses(const OwnInterface &interface) {
  std::vector<OwnAddress> candidates;
  std::copy_if(interface.addresses.begin(), interface.addresses.end(),
               std::back_inserter(candidates),
               [&](const OwnAddress &own) { return interface.loopback || !own.local; });
  std::sort(candidates.begin(), candidates.end(), preferred);
  if (candidates.size() > KARST_NET_INTERFACE_MAX_ADDRESSES) {
    logWarning("interface %s has %zu addresses: the first %u are published", interface.name.c_str(),
               candidates.size(), KARST_NET_INTERFACE_MAX_ADDRESSES);
    candidates.resize(KARST_NET_INTERFACE_MAX_ADDRESSES);
  }
  std::vector<KarstIpAddress> addresses;
  addresses.reserve(candidates.size());
  for (const OwnAddress &own : candidates) addresses.push_back(own.address);
  return addresses;
}

std::vector<Entry> entriesOf(const OwnNode &node, const std::vector<OwnInterface> &interfaces) {
  KarstNodeEntry nodeRecord{};
  nodeRecord.majorVersionNum = node.majorVersion;
  nodeRecord.minorVersionNum = node.minorVersion;
  if (node.witness) nodeRecord.flags |= KARST_NODE_FLAG_WITNESS;
  std::vector<Entry> entries{{KARST_TYPE_NODE, node.uuid, node.uuid, encode(nodeRecord)}};

  for (const OwnInterface &interface : interfaces) {
    if (interface.loopback && !node.includeLoopback) continue;
    const auto addresses = publishedAddresses(interface);
    if (addresses.empty()) continue;
    const zel_UUID uuid = namedUUID(node.uuid, interface.name);
    KarstHealthStatusEntry health{};
    health.healthFlags = interface.carrier ? 0 : 1;
    entries.push_back({KARST_TYPE_NET_INTERFACE, uuid, node.uuid, recordOf(interface, addresses)});
    entries.push_back({KARST_TYPE_HEALTH_STATUS, uuid, node.uuid, encode(health)});
  }
  std::sort(entries.begin(), entries.end(), comesBefore);
  return entries;
}

}  // namespace host
