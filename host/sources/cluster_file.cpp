/* From the text of a cluster file to directory entries: JSON, then the schema's rules, then those
 * that no schema can state. No lock.
 */
#include "host/sources/cluster_file.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>
#include <set>
#include <utility>

#include "host/directory/records.h"
#include "host/sources/cluster_schema.h"
#include "host/sources/published_entries.h"

namespace host {
namespace {

using json = nlohmann::json;
using Path = json::json_pointer;

/* The names on the way are the file's own: escaped and shortened, so that the line stays one. */
std::string at(const Path &path) {
  if (path.empty()) return "top level";
  constexpr size_t longest = 200;
  const std::string quoted = json(path.to_string()).dump(-1, ' ', true);
  const std::string text = quoted.substr(1, quoted.size() - 2);
  return text.size() > longest ? text.substr(0, longest) + "..." : text;
}

/* A rule that a place in the document breaks. */
struct Refusal {
  Path path;
  std::string rule;
};

/* ---- JSON ------------------------------------------------------------------------------------ */

/* Refuses a field that is given twice in one object: the parser would keep the last of the two in
 * silence, and the author of the file may mean the first. */
class DuplicateFields {
 public:
  bool operator()(int, json::parse_event_t event, const json &parsed) {
    switch (event) {
      case json::parse_event_t::object_start:
      case json::parse_event_t::array_start:
        beginValue();
        levels_.push_back({event == json::parse_event_t::array_start, 0, {}, {}});
        break;
      case json::parse_event_t::object_end:
      case json::parse_event_t::array_end:
        levels_.pop_back();
        break;
      case json::parse_event_t::key:
        beginField(parsed.get<std::string>());
        break;
      case json::parse_event_t::value:
        beginValue();
        break;
    }
    return true;
  }

 private:
  struct Level {
    bool array;
    size_t items; /* begun so far */
    std::string field;
    std::set<std::string> fields;
  };

  void beginValue() {
    if (!levels_.empty() && levels_.back().array) levels_.back().items++;
  }

  void beginField(const std::string &name) {
    if (!levels_.back().fields.insert(name).second) {
      throw Refusal{pathOfObject(),
                    "field " + shown(name) + " is given twice; keep one of the two"};
    }
    levels_.back().field = name;
  }

  Path pathOfObject() const {
    Path path;
    for (size_t i = 0; i + 1 < levels_.size(); i++) {
      const Level &level = levels_[i];
      path.push_back(level.array ? std::to_string(level.items - 1) : level.field);
    }
    return path;
  }

  std::vector<Level> levels_;
};

/* "LINE:COLUMN" of a byte, counted from 1. */
std::string positionOf(const std::string &text, size_t byte) {
  const std::string before = text.substr(0, byte == 0 ? 0 : byte - 1);
  const auto line = 1 + std::count(before.begin(), before.end(), '\n');
  const size_t lineStart = before.rfind('\n') == std::string::npos ? 0 : before.rfind('\n') + 1;
  return std::to_string(line) + ":" + std::to_string(before.size() - lineStart + 1);
}

/* What the parser says, without its own prefix, and with little of what it read last: that may be
 * most of the file. */
std::string parserWords(const std::string &what, const std::string &prefixEnd) {
  constexpr size_t longest = 60;
  const std::string readMark = "last read: '";
  const size_t end = what.find(prefixEnd);
  std::string words = end == std::string::npos ? what : what.substr(end + prefixEnd.size());
  const size_t mark = words.find(readMark);
  if (mark == std::string::npos) return words;
  const size_t read = mark + readMark.size();
  const size_t readEnd = std::min(words.rfind("'; expected "), words.size() - 1);
  if (readEnd > read + longest) words.replace(read + longest, readEnd - read - longest, "...");
  return words;
}

json parseJSON(const std::string &text, const std::string &fileName) {
  DuplicateFields duplicates;
  try {
    return json::parse(text, std::ref(duplicates));
  } catch (const json::parse_error &error) {
    throw ClusterFileError(fileName + ":" + positionOf(text, error.byte) +
                           ": no valid JSON: " + parserWords(error.what(), ": "));
  } catch (const json::exception &error) {
    throw ClusterFileError(fileName + ": no valid JSON: " + parserWords(error.what(), "] "));
  }
}

/* ---- Values that the schema has passed as text ----------------------------------------------- */

KarstIpAddress readAddress(const json &value, const Path &path) {
  const auto &text = value.get_ref<const std::string &>();
  KarstIpAddress address{};
  if (inet_pton(AF_INET, text.c_str(), address.address) == 1) return address;
  address.isIPv6 = 1;
  if (inet_pton(AF_INET6, text.c_str(), address.address) == 1) return address;
  throw Refusal{path, shown(value) +
                          " is no address; expected: IPv4, such as \"192.0.2.1\", or "
                          "IPv6, such as \"2001:db8::1\", without a prefix length"};
}

/* Like readAddress, of one family only; copies its bytes to `out`. */
void readAddressOf(int family, const json &value, const Path &path, uint8_t *out) {
  if (inet_pton(family, value.get_ref<const std::string &>().c_str(), out) == 1) return;
  throw Refusal{path, shown(value) + (family == AF_INET
                                          ? " is no IPv4 address; expected: such as \"192.0.2.1\""
                                          : " is no IPv6 address; expected: such as \"ff02::1\"")};
}

std::vector<uint8_t> readHex(const json &value, const Path &path) {
  const auto &text = value.get_ref<const std::string &>();
  const bool digits = text.find_first_not_of("0123456789abcdefABCDEF") == std::string::npos;
  if (!digits || text.size() % 2 != 0) {
    throw Refusal{path, shown(value) + " is refused; expected: hexadecimal digits in pairs"};
  }
  std::vector<uint8_t> bytes;
  for (size_t i = 0; i < text.size(); i += 2) {
    bytes.push_back(static_cast<uint8_t>(std::stoul(text.substr(i, 2), nullptr, 16)));
  }
  return bytes;
}

uint32_t numberOr(const json &object, const char *field, uint32_t absent) {
  return object.contains(field) ? object.at(field).get<uint32_t>() : absent;
}

/* ---- Rules beyond the schema ----------------------------------------------------------------- */

class ContentReader {
 public:
  ClusterContent read(const json &document);

 private:
  zel_UUID readUUID(const json &value, const Path &path) const;
  zel_UUID readEntryUUID(uint8_t type, const char *kind, const json &object, const Path &path);
  void readNode(const json &node, const Path &path);
  void readInterface(const json &interface, const Path &path, const zel_UUID &owner);
  void readHealth(const json &interface, const Path &path, const zel_UUID &uuid,
                  const zel_UUID &owner);
  void readObject(const json &object, const Path &path);

  ClusterContent content_;
  std::map<std::pair<uint8_t, zel_UUID>, Path> places_; /* of the entries read so far */
};

/* An entry whose record is given raw has no use for fields that the record would be made from. */
void refuseBesideRawRecord(const json &object, const Path &path,
                           const std::set<std::string> &allowed) {
  for (const auto &[field, unused] : object.items()) {
    if (field != "rawRecord" && allowed.count(field) == 0) {
      throw Refusal{path, "field \"" + field +
                              "\" beside \"rawRecord\", which stands in for the whole record; "
                              "leave out one of the two"};
    }
  }
}

std::vector<uint8_t> nodeRecord(const json &node, const Path &path) {
  if (node.contains("rawRecord")) {
    refuseBesideRawRecord(node, path, {"uuid", "name", "interfaces"});
    return readHex(node.at("rawRecord"), path / "rawRecord");
  }
  KarstNodeEntry record{};
  if (node.contains("version")) {
    record.majorVersionNum = node.at("version").at("major").get<uint32_t>();
    record.minorVersionNum = node.at("version").at("minor").get<uint32_t>();
  }
  if (node.value("witness", false)) record.flags |= KARST_NODE_FLAG_WITNESS;
  return encode(record);
}

void readInterfaceAddresses(const json &interface, const Path &path,
                            KarstNetInterfaceEntry *record) {
  if (interface.contains("addresses")) {
    const Path listPath = path / "addresses";
    for (const json &address : interface.at("addresses")) {
      const uint32_t index = record->numIpAddresses++;
      record->ipAddresses[index] = readAddress(address, listPath / index);
    }
  }
  if (!interface.contains("ipv4")) return;
  readAddressOf(AF_INET, interface.at("ipv4"), path / "ipv4", record->ipv4Address);
  if (record->networkType != KARST_NETWORK_TYPE_IP) {
    throw Refusal{path / "ipv4",
                  "only an interface of networkType 1 has this address; leave it out"};
  }
}

void readMAC(const std::string &text, uint8_t *out) {
  for (size_t i = 0; i < 6; i++) {
    out[i] = static_cast<uint8_t>(std::stoul(text.substr(3 * i, 2), nullptr, 16));
  }
}

std::vector<uint8_t> interfaceRecord(const json &interface, const Path &path) {
  if (interface.contains("rawRecord")) {
    refuseBesideRawRecord(interface, path, {"uuid", "name", "healthy", "healthFlags"});
    return readHex(interface.at("rawRecord"), path / "rawRecord");
  }
  KarstNetInterfaceEntry record{};
  record.networkType = numberOr(interface, "networkType", KARST_NETWORK_TYPE_IP);
  readInterfaceAddresses(interface, path, &record);
  record.agentGroupPort = numberOr(interface, "agentGroupPort", 0);
  record.masterGroupPort = numberOr(interface, "masterGroupPort", 0);
  record.multicastTTL = numberOr(interface, "multicastTTL", 0);
  if (interface.contains("bandwidth")) record.bandwidth = interface.at("bandwidth").get<uint64_t>();
  if (interface.contains("mac")) {
    readMAC(interface.at("mac").get_ref<const std::string &>(), record.macAddress);
  }
  for (const auto &[field, group] :
       {std::pair<const char *, uint8_t *>{"agentV6Group", record.agentV6Group},
        {"masterV6Group", record.masterV6Group}}) {
    if (interface.contains(field))
      readAddressOf(AF_INET6, interface.at(field), path / field, group);
  }
  if (interface.contains("trafficTypes")) {
    for (const json &type : interface.at("trafficTypes")) {
      record.trafficTypeMask |= uint64_t{1} << type.get<unsigned>();
    }
  }
  return encode(record);
}

zel_UUID ContentReader::readUUID(const json &value, const Path &path) const {
  const auto uuid = parseUUID(value.get_ref<const std::string &>());
  if (!uuid || isZero(*uuid)) {
    throw Refusal{path, shown(value) +
                            " is refused; expected: a UUID other than the all-zero one, "
                            "which stands for none"};
  }
  return *uuid;
}

/* The UUID of a new entry, with the name that people know it by. */
zel_UUID ContentReader::readEntryUUID(uint8_t type, const char *kind, const json &object,
                                      const Path &path) {
  const zel_UUID uuid = readUUID(object.at("uuid"), path / "uuid");
  const auto [place, isNew] = places_.try_emplace({type, uuid}, path);
  if (!isNew) {
    throw Refusal{path / "uuid", std::string(kind) + " " + toString(uuid) +
                                     " is there already, at " + at(place->second) +
                                     "; give each its own UUID"};
  }
  if (object.contains("name")) {
    content_.names.try_emplace(uuid, object.at("name").get<std::string>());
  }
  return uuid;
}

void ContentReader::readHealth(const json &interface, const Path &path, const zel_UUID &uuid,
                               const zel_UUID &owner) {
  const json healthy = interface.value("healthy", json(true));
  KarstHealthStatusEntry record{};
  if (interface.contains("healthFlags") && healthy != json(false)) {
    throw Refusal{path / "healthFlags",
                  "only an interface with \"healthy\": false has these flags; "
                  "leave one of the two out or make the interface unhealthy"};
  }
  if (healthy.is_null()) return;
  if (healthy == json(false)) record.healthFlags = numberOr(interface, "healthFlags", 1);
  content_.entries.push_back({KARST_TYPE_HEALTH_STATUS, uuid, owner, encode(record)});
}

void ContentReader::readInterface(const json &interface, const Path &path, const zel_UUID &owner) {
  const zel_UUID uuid = readEntryUUID(KARST_TYPE_NET_INTERFACE, "interface", interface, path);
  content_.entries.push_back(
      {KARST_TYPE_NET_INTERFACE, uuid, owner, interfaceRecord(interface, path)});
  readHealth(interface, path, uuid, owner);
}

void ContentReader::readNode(const json &node, const Path &path) {
  const zel_UUID uuid = readEntryUUID(KARST_TYPE_NODE, "node", node, path);
  content_.entries.push_back({KARST_TYPE_NODE, uuid, uuid, nodeRecord(node, path)});
  if (!node.contains("interfaces")) return;
  const json &interfaces = node.at("interfaces");
  for (size_t i = 0; i < interfaces.size(); i++) {
    readInterface(interfaces[i], path / "interfaces" / i, uuid);
  }
}

void ContentReader::readObject(const json &object, const Path &path) {
  const auto type = object.at("type").get<uint8_t>();
  const zel_UUID uuid = readEntryUUID(type, "an object of this type and UUID,", object, path);
  const zel_UUID owner = readUUID(object.at("owner"), path / "owner");
  if (places_.count({KARST_TYPE_NODE, owner}) == 0 && content_.self != owner) {
    throw Refusal{path / "owner", "node " + toString(owner) +
                                      " is not in this file; expected: the UUID of one of its "
                                      "nodes or its \"self\""};
  }
  content_.entries.push_back({type, uuid, owner, {}});
}

ClusterContent ContentReader::read(const json &document) {
  if (document.contains("self")) {
    content_.self = readUUID(document.at("self"), Path("/self"));
  }
  const json &nodes = document.at("nodes");
  for (size_t i = 0; i < nodes.size(); i++) readNode(nodes[i], Path("/nodes") / i);
  if (document.contains("objects")) {
    const json &objects = document.at("objects");
    for (size_t i = 0; i < objects.size(); i++) readObject(objects[i], Path("/objects") / i);
  }
  std::sort(content_.entries.begin(), content_.entries.end(), comesBefore);
  return std::move(content_);
}

}  // namespace

ClusterContent parseClusterText(const std::string &text, const std::string &fileName) {
  try {
    const json document = parseJSON(text, fileName);
    if (const auto fault = findSchemaFault(document)) throw Refusal{fault->path, fault->rule};
    return ContentReader().read(document);
  } catch (const Refusal &refusal) {
    throw ClusterFileError(fileName + ": " + at(refusal.path) + ": " + refusal.rule);
  }
}

ClusterContent parseClusterFile(const std::string &path) {
  std::ifstream file(path, std::ios::binary);
  if (!file) throw ClusterFileError(path + ": cannot be opened: " + std::strerror(errno));
  std::string text;
  try {
    text.assign(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
  } catch (const std::ios_base::failure &failure) {
    throw ClusterFileError(path + ": cannot be read: " + failure.code().message());
  }
  return parseClusterText(text, path);
}

}  // namespace host
