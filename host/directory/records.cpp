/* The tables of the three records that the directory knows, and the nested pairs of the interface
 * record: its network part and its addresses. No lock.
 */
#include "host/directory/records.h"

#include <cstring>
#include <limits>
#include <string_view>

#include "host/directory/cbor.h"
#include "host/directory/marshaller.h"
#include "host/kernel/panic.h"

namespace host {
namespace {

constexpr uint32_t ipv4Size = 4;
constexpr uint32_t ipv6Size = 16;

/* The fields of an interface record that each nested pair covers, as they lie in it. */
struct NetworkPart {
  uint32_t type;
  uint8_t ipv4[ipv4Size];
};
static_assert(offsetof(KarstNetInterfaceEntry, networkType) == 0);
static_assert(offsetof(KarstNetInterfaceEntry, ipv4Address) == offsetof(NetworkPart, ipv4));

struct AddressList {
  uint32_t count;
  KarstIpAddress addresses[KARST_NET_INTERFACE_MAX_ADDRESSES];
};
static_assert(offsetof(KarstNetInterfaceEntry, ipAddresses) -
                  offsetof(KarstNetInterfaceEntry, numIpAddresses) ==
              offsetof(AddressList, addresses));

constexpr ExprMshField plain(uint64_t type, uint64_t offset, const char *name) {
  return {type, offset, 0, name, nullptr, nullptr, {0, 0}};
}

constexpr ExprMshField end{};

template <typename Record>
std::vector<uint8_t> encodeAs(const ExprMshField *table, const Record &record) {
  std::vector<uint8_t> data;
  const zel_Status status = marshal(table, &record, &data);
  if (status != ZEL_OK) panic("A directory record cannot be encoded: status 0x%x", status);
  return data;
}

template <typename Record>
zel_Status decodeAs(const ExprMshField *table, const std::vector<uint8_t> &data, Record *record) {
  *record = {};
  if (data.size() > std::numeric_limits<uint32_t>::max()) return EXPR_MSH_OUT_OF_RANGE;
  return unmarshal(table, data.data(), static_cast<uint32_t>(data.size()), record);
}

/* One pair of the network part's map. */
zel_Status readNetworkPair(ExprMshReader &reader, NetworkPart *part, bool *typeSeen,
                           bool *ipv4Seen) {
  std::string_view name = *typeSeen ? "ipv4" : "type"; /* what most writers have here */
  zel_Status status = skipName(reader, name) ? ZEL_OK : readName(reader, &name);
  if (status != ZEL_OK) return status;
  if (name == "type") {
    if (*typeSeen) return EXPR_MSH_MALFORMED;
    *typeSeen = true;
    uint64_t type = 0;
    status = readUnsigned(reader, std::numeric_limits<uint32_t>::max(), &type);
    part->type = static_cast<uint32_t>(type);
    return status;
  }
  if (name == "ipv4") {
    if (*ipv4Seen) return EXPR_MSH_MALFORMED;
    *ipv4Seen = true;
    size_t length = 0;
    status = readBytes(reader, ipv4Size, part->ipv4, &length);
    return status == ZEL_OK && length != ipv4Size ? EXPR_MSH_OUT_OF_RANGE : status;
  }
  return skipValue(reader);
}

zel_Status readAddress(ExprMshReader &reader, KarstIpAddress *address) {
  *address = {};
  size_t length = 0;
  const zel_Status status = readBytes(reader, ipv6Size, address->address, &length);
  if (status != ZEL_OK) return status;
  if (length != ipv4Size && length != ipv6Size) return EXPR_MSH_OUT_OF_RANGE;
  address->isIPv6 = length == ipv6Size ? 1 : 0;
  return ZEL_OK;
}

}  // namespace

const ExprMshField nodeRecordTable[] = {
    plain(EXPR_MSH_U32, offsetof(KarstNodeEntry, majorVersionNum), "majorVersionNum"),
    plain(EXPR_MSH_U32, offsetof(KarstNodeEntry, minorVersionNum), "minorVersionNum"),
    plain(EXPR_MSH_U32, offsetof(KarstNodeEntry, flags), "flags"),
    plain(EXPR_MSH_U32, offsetof(KarstNodeEntry, requiredTolmMajorVersion),
          "requiredTolmMajorVersion"),
    plain(EXPR_MSH_U32, offsetof(KarstNodeEntry, requiredTolmMinorVersion),
          "requiredTolmMinorVersion"),
    end,
};

const ExprMshField netInterfaceRecordTable[] = {
    {EXPR_MSH_NESTED,
     offsetof(KarstNetInterfaceEntry, networkType),
     0,
     "networkType",
     ExprMsh_MshNetInterfaceEntry,
     ExprMsh_UmshNetInterfaceEntry,
     {0, 0}},
    plain(EXPR_MSH_U32, offsetof(KarstNetInterfaceEntry, agentGroupPort), "agentGroupPort"),
    plain(EXPR_MSH_U32, offsetof(KarstNetInterfaceEntry, masterGroupPort), "masterGroupPort"),
    plain(EXPR_MSH_U32, offsetof(KarstNetInterfaceEntry, multicastTTL), "multicastTTL"),
    plain(EXPR_MSH_U64, offsetof(KarstNetInterfaceEntry, bandwidth), "bandwidth"),
    plain(EXPR_MSH_MAC, offsetof(KarstNetInterfaceEntry, macAddress), "macAddress"),
    plain(EXPR_MSH_ADDRESS, offsetof(KarstNetInterfaceEntry, agentV6Group), "agentV6Group"),
    plain(EXPR_MSH_ADDRESS, offsetof(KarstNetInterfaceEntry, masterV6Group), "masterV6Group"),
    {EXPR_MSH_NESTED,
     offsetof(KarstNetInterfaceEntry, numIpAddresses),
     0,
     "numIpAddresses",
     ExprMsh_MshNetInterfaceEntryIpAddresses,
     ExprMsh_UmshNetInterfaceEntryIpAddresses,
     {0, 0}},
    plain(EXPR_MSH_U64, offsetof(KarstNetInterfaceEntry, trafficTypeMask), "trafficTypeMask"),
    end,
};

const ExprMshField healthRecordTable[] = {
    plain(EXPR_MSH_U32, offsetof(KarstHealthStatusEntry, healthFlags), "healthFlags"),
    plain(EXPR_MSH_U64, offsetof(KarstHealthStatusEntry, timestamp), "timestamp"),
    plain(EXPR_MSH_U32, offsetof(KarstHealthStatusEntry, healthReason), "healthReason"),
    end,
};

std::vector<uint8_t> encode(const KarstNodeEntry &record) {
  return encodeAs(nodeRecordTable, record);
}

std::vector<uint8_t> encode(const KarstNetInterfaceEntry &record) {
  return encodeAs(netInterfaceRecordTable, record);
}

std::vector<uint8_t> encode(const KarstHealthStatusEntry &record) {
  return encodeAs(healthRecordTable, record);
}

zel_Status decode(const std::vector<uint8_t> &data, KarstNodeEntry *record) {
  return decodeAs(nodeRecordTable, data, record);
}

zel_Status decode(const std::vector<uint8_t> &data, KarstNetInterfaceEntry *record) {
  return decodeAs(netInterfaceRecordTable, data, record);
}

zel_Status decode(const std::vector<uint8_t> &data, KarstHealthStatusEntry *record) {
  return decodeAs(healthRecordTable, data, record);
}

}  // namespace host

/* ---- The nested pairs, which readers' tables name -------------------------------------------- */

zel_Status ExprMsh_MshNetInterfaceEntry(ExprMshWriter *writer, const void *field) {
  host::NetworkPart part;
  std::memcpy(&part, field, sizeof part);
  const bool hasIpv4 = part.type == KARST_NETWORK_TYPE_IP &&
                       std::memcmp(part.ipv4, host::NetworkPart{}.ipv4, sizeof part.ipv4) != 0;
  host::writeMapStart(*writer, hasIpv4 ? 2 : 1);
  host::writeName(*writer, "type");
  host::writeUnsigned(*writer, part.type);
  if (hasIpv4) {
    host::writeName(*writer, "ipv4");
    host::writeBytes(*writer, part.ipv4, sizeof part.ipv4);
  }
  return ZEL_OK;
}

zel_Status ExprMsh_UmshNetInterfaceEntry(ExprMshReader *reader, void *field) {
  host::NetworkPart part;
  std::memcpy(&part, field, sizeof part);
  host::CborContainer map;
  zel_Status status = host::openMap(*reader, &map);
  bool more = true, typeSeen = false, ipv4Seen = false;
  while (status == ZEL_OK) {
    status = host::nextElement(*reader, &map, &more);
    if (status != ZEL_OK || !more) break;
    status = host::readNetworkPair(*reader, &part, &typeSeen, &ipv4Seen);
  }
  if (status != ZEL_OK) return status;
  /* The address belongs to the type, and the type may come behind it. */
  std::memcpy(field, &part, part.type == KARST_NETWORK_TYPE_IP ? sizeof part : sizeof part.type);
  return ZEL_OK;
}

zel_Status ExprMsh_MshNetInterfaceEntryIpAddresses(ExprMshWriter *writer, const void *field) {
  host::AddressList list;
  std::memcpy(&list, field, sizeof list);
  if (list.count > KARST_NET_INTERFACE_MAX_ADDRESSES) return EXPR_MSH_OUT_OF_RANGE;
  host::writeArrayStart(*writer, list.count);
  for (uint32_t i = 0; i < list.count; ++i) {
    const KarstIpAddress &address = list.addresses[i];
    host::writeBytes(*writer, address.address,
                     address.isIPv6 != 0 ? host::ipv6Size : host::ipv4Size);
  }
  return ZEL_OK;
}

zel_Status ExprMsh_UmshNetInterfaceEntryIpAddresses(ExprMshReader *reader, void *field) {
  host::AddressList list;
  std::memcpy(&list, field, sizeof list);
  host::CborContainer array;
  zel_Status status = host::openArray(*reader, &array);
  list.count = 0;
  bool more = true;
  while (status == ZEL_OK) {
    status = host::nextElement(*reader, &array, &more);
    if (status != ZEL_OK || !more) break;
    if (list.count == KARST_NET_INTERFACE_MAX_ADDRESSES) return EXPR_MSH_OUT_OF_RANGE;
    status = host::readAddress(*reader, &list.addresses[list.count]);
    ++list.count;
  }
  if (status == ZEL_OK) std::memcpy(field, &list, sizeof list);
  return status;
}
