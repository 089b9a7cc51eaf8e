/* What feeds the directory: the cluster file with its rules and its reloads, and this machine's own
 * interfaces.
 */
#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <regex>

#include "host/directory/records.h"
#include "host/kernel/text.h"
#include "host/sources/cluster_file_source.h"
#include "host/sources/machine_uuid.h"
#include "host/sources/own_interfaces_source.h"
#include "tests/log_lines.h"

namespace {

using host::Entry;
using host::toString;
using namespace testing;

/* ---- Shorthand: UUIDs that end in two digits of choice --------------------------------------- */

/* @a1 stands for the UUID that ends in a1, in quotation marks, #a1 for the same without. */
std::string expand(const std::string &text) {
  static const std::regex quoted("@([a-c]\\d)");
  static const std::regex plain("#([a-c]\\d)");
  return std::regex_replace(std::regex_replace(text, quoted, "\"#$1\""), plain,
                            "00000000-0000-4000-8000-0000000000$1");
}
zel_UUID uuid(const char *end) {
  return host::parseUUID(expand(std::string("#") + end)).value();
}
host::ClusterContent parse(const std::string &text) {
  return host::parseClusterText(expand(text), "c.json");
}

/* An otherwise good file with these fields of a node, or of its interface, beside the UUID. */
std::string node(const std::string &fields) {
  return R"({"nodes":[{"uuid":@a1,)" + fields + "}]}";
}
std::string interface(const std::string &fields) {
  return node(R"("interfaces":[{"uuid":@b1,)" + fields + "}]");
}
std::string objects(const std::string &list) {
  return R"({"self":@a9,"nodes":[{"uuid":@a1}],"objects":[)" + list + "]}";
}

/* ---- Entries as text, with the last two digits of their UUIDs --------------------------------- */

std::string endOf(const zel_UUID &uuid) {
  return toString(uuid).substr(34);
}
std::string hexOf(const uint8_t *bytes, size_t size) {
  std::string text;
  for (size_t i = 0; i < size; i++) text += host::formatText("%02x", bytes[i]);
  return text;
}
std::string textOf(const uint8_t *address, bool isIPv6) {
  char text[INET6_ADDRSTRLEN];
  return inet_ntop(isIPv6 ? AF_INET6 : AF_INET, address, text, sizeof text);
}
std::string textOf(const std::vector<KarstIpAddress> &addresses) {
  std::string text;
  for (const auto &one : addresses) text += " " + textOf(one.address, one.isIPv6);
  return text;
}

std::string shown(const Entry &entry) {
  const std::string whose = endOf(entry.uuid) + " of " + endOf(entry.owner) + ": ";
  KarstNodeEntry node;
  KarstHealthStatusEntry health;
  KarstNetInterfaceEntry netIf;
  if (entry.type == KARST_TYPE_NODE && host::decode(entry.data, &node) == ZEL_OK) {
    return host::formatText("node %s%u.%u flags %u", whose.c_str(), node.majorVersionNum,
                            node.minorVersionNum, node.flags);
  }
  if (entry.type == KARST_TYPE_HEALTH_STATUS && host::decode(entry.data, &health) == ZEL_OK) {
    return "health " + whose + std::to_string(health.healthFlags);
  }
  if (entry.type != KARST_TYPE_NET_INTERFACE || host::decode(entry.data, &netIf) != ZEL_OK) {
    return std::to_string(entry.type) + " " + whose + hexOf(entry.data.data(), entry.data.size());
  }
  const std::vector<KarstIpAddress> addresses(netIf.ipAddresses,
                                              netIf.ipAddresses + netIf.numIpAddresses);
  return host::formatText(
      "interface %stype %u, %s,%s, ports %u %u, TTL %u, bandwidth %lu, MAC %s, groups %s %s, "
      "traffic %lx",
      whose.c_str(), netIf.networkType, textOf(netIf.ipv4Address, false).c_str(),
      textOf(addresses).c_str(), netIf.agentGroupPort, netIf.masterGroupPort, netIf.multicastTTL,
      netIf.bandwidth, hexOf(netIf.macAddress, 6).c_str(), textOf(netIf.agentV6Group, true).c_str(),
      textOf(netIf.masterV6Group, true).c_str(), netIf.trafficTypeMask);
}
std::vector<std::string> shown(const std::vector<Entry> &entries) {
  std::vector<std::string> texts;
  for (const Entry &entry : entries) texts.push_back(shown(entry));
  return texts;
}

/* ---- The cluster file: what is refused, where, and in which words ---------------------------- */

/* What is refused, where, and how the reason begins. */
struct Refusal {
  std::string text, place, reason;
};

const std::string twice = R"({"type":9,"uuid":@c1,"owner":@a1},{"type":9,"uuid":@c1,"owner":@a9})";

const Refusal refusals[] = {
    {"", ":1:1", "no valid JSON: syntax error while parsing value - unexpected end of input; exp"},
    {"{\n \"nodes\": [\n  {} {}\n ]\n}", ":3:6", "no valid JSON: syntax error while parsing array"},
    {R"({"nodes":[],"nodes":[]})", ": top level", R"(field "nodes" is given twice; keep one)"},
    {node(R"("interfaces":[],"uuid":@a3)"), ": /nodes/0", R"(field "uuid" is given twice; keep)"},
    {node(R"("colour":"red")"), ": /nodes/0",
     R"(unknown field "colour"; known here: interfaces, name, rawRecord, uuid, version, witness)"},
    {R"({"nodes":[],"a: b\nc":1})", ": top level", R"(unknown field "a: b\nc"; known here: $sch)"},
    {R"({"a\nb":[{"c":1,"c":2}],"nodes":[]})", ": /a\\nb/0",
     R"(field "c" is given twice; keep one)"},
    {R"({"nodes":")" + std::string(1000, 'x'), ":1:1011",
     "no valid JSON: syntax error while parsing value - invalid string: missing closing quote; "
     "last read: '\"" +
         std::string(59, 'x') + "...'"},
    {node(R"("rawRecord":"a0f")"), ": /nodes/0/rawRecord", "\"a0f\" is refused; expected: hex"},
    {R"({"nodes":[{"uuid":"node-1"}]})", ": /nodes/0/uuid",
     "\"node-1\" is refused; expected: A UUID: 32 hexadecimal digits, plain or as 8-4-4-4-12"},
    {R"({"self":"00000000000000000000000000000000","nodes":[]})", ": /self",
     "\"00000000000000000000000000000000\" is refused; expected: a UUID other than the all-zero"},
    {R"({"nodes":[{"uuid":@a1,"interfaces":[{"uuid":@b1}]},
                  {"uuid":@a2,"interfaces":[{"uuid":@b2},{"uuid":@b1}]}]})",
     ": /nodes/1/interfaces/1/uuid", "interface #b1 is there already, at /nodes/0/interfaces/0;"},
    {objects(twice), ": /objects/1/uuid", "an object of this type and UUID, #c1 is there"},
    {objects(R"({"type":9,"uuid":@c1})"), ": /objects/0", "missing field \"owner\"; expected: The"},
    {objects(R"({"type":9,"uuid":@c1,"owner":@a8})"), ": /objects/0/owner",
     R"(node #a8 is not in this file; expected: the UUID of one of its nodes or its "self")"},
    {objects(R"({"type":3,"uuid":@c1,"owner":@a1})"), ": /objects/0/type", "3 is refused"},
};

/* The same of an interface: its fields, and places in it. */
const Refusal interfaceRefusals[] = {
    {R"("addresses":["::1","::2","::3","::4","::5","::6","::7","::8"])", "/addresses",
     "too many items (8); expected: The interface's addresses"},
    {R"("addresses":["::1","192.0.2.300"])", "/addresses/1", R"("192.0.2.300" is no address; exp)"},
    {R"("ipv4":"2001:db8::1")", "/ipv4", R"("2001:db8::1" is no IPv4 address; expected: such as)"},
    {R"("masterV6Group":"224.2.3.4")", "/masterV6Group", R"("224.2.3.4" is no IPv6 address; exp)"},
    {R"("networkType":2,"ipv4":"192.0.2.1")", "/ipv4", "only an interface of networkType 1 has"},
    {R"("bandwidth":9223372036854775808)", "/bandwidth", "9223372036854775808 is refused"},
    {R"("trafficTypes":[0,64])", "/trafficTypes/1", "64 is refused; expected: A type of traffic"},
    {R"("healthFlags":2)", "/healthFlags", R"(only an interface with "healthy": false has these)"},
    {R"("rawRecord":"a0","ipv4":"192.0.2.1")", "", R"(field "ipv4" beside "rawRecord", which)"},
};

void expectRefusal(const std::string &text, const std::string &placeAndReason) {
  EXPECT_THAT([&] { parse(text); },
              ThrowsMessage<host::ClusterFileError>(StartsWith(expand("c.json" + placeAndReason))))
      << text;
}

TEST(ClusterFile, RefusalsNamePlaceAndRule) {
  for (const auto &[text, place, reason] : refusals) expectRefusal(text, place + ": " + reason);
  for (const auto &[fields, place, reason] : interfaceRefusals) {
    expectRefusal(interface(fields), ": /nodes/0/interfaces/0" + place + ": " + reason);
  }
  EXPECT_THAT([] { host::parseClusterFile("/nonexistent/c.json"); },
              ThrowsMessage<host::ClusterFileError>(
                  "/nonexistent/c.json: cannot be opened: No such file or directory"));
  EXPECT_THROW(host::parseClusterFile("/"), host::ClusterFileError);
}

/* ---- The cluster file: what a good one means ------------------------------------------------- */

TEST(ClusterFile, EveryFieldOfNodesInterfacesAndObjectsBecomesAnEntryOfItsOwner) {
  const auto content = parse(R"({"$schema":"cluster.schema.json","self":@a9,"nodes":[
      {"uuid":@a2,"name":"beta","version":{"major":7,"minor":4294967295},"witness":true,
       "interfaces":[{"uuid":@b1,
         "networkType":1, "addresses":["2001:db8::7","192.0.2.7"], "ipv4":"198.51.100.7",
         "trafficTypes":[0,1,63], "mac":"02:00:5e:10:0a:FF", "bandwidth":9223372036854775807,
         "agentGroupPort":12345, "masterGroupPort":23451, "multicastTTL":5,
         "agentV6Group":"ff02::2:3:4", "masterV6Group":"ff02::1:2:3"}]},
      {"uuid":@a3,"rawRecord":"00fF"},
      {"uuid":@a1,"interfaces":[{"uuid":@b3,"healthy":false}, {"uuid":@b2,"name":"eth0"},
        {"uuid":@b4,"healthy":null}, {"uuid":@b5,"healthy":false,"healthFlags":6}]}],
    "objects":[{"type":255,"uuid":@c1,"owner":@a9,"name":"volume"},
               {"type":0,"uuid":@c1,"owner":@a1}]})");
  EXPECT_EQ(content.self, uuid("a9"));
  EXPECT_THAT(content.names, ElementsAre(Pair(uuid("a2"), "beta"), Pair(uuid("b2"), "eth0"),
                                         Pair(uuid("c1"), "volume")));
  const std::string plain =
      "type 1, 0.0.0.0,, ports 0 0, TTL 0, bandwidth 0, MAC 000000000000, groups :: ::, traffic 0";
  EXPECT_THAT(
      shown(content.entries),
      ElementsAre("0 c1 of a1: ", "node a1 of a1: 0.0 flags 0",
                  "node a2 of a2: 7.4294967295 flags 2", "3 a3 of a3: 00ff",
                  "interface b1 of a2: type 1, 198.51.100.7, 2001:db8::7 192.0.2.7, "
                  "ports 12345 23451, TTL 5, bandwidth 9223372036854775807, MAC 02005e100aff, "
                  "groups ff02::2:3:4 ff02::1:2:3, traffic 8000000000000003",
                  "interface b2 of a1: " + plain, "interface b3 of a1: " + plain,
                  "interface b4 of a1: " + plain, "interface b5 of a1: " + plain,
                  "health b1 of a2: 0", "health b2 of a1: 0", "health b3 of a1: 1",
                  "health b5 of a1: 6", "255 c1 of a9: "));
}

TEST(ClusterFile, TheExampleIsGoodAndNamesItsNodes) {
  EXPECT_GE(host::parseClusterFile(CLUSTER_EXAMPLE).names.size(), 9u);
}

/* ---- Differences ----------------------------------------------------------------------------- */

TEST(Difference, BuildsFromTheGroundUpAndTakesDownFromTheTop) {
  const auto entry = [](uint8_t type, const char *end, uint8_t data = 0) {
    return Entry{type, uuid(end), uuid("a1"), {data}};
  };
  const Entry low = entry(0, "c1"), node = entry(3, "a1"), interface = entry(6, "b1"),
              health = entry(7, "b1"), high = entry(9, "c2");
  const std::vector<Entry> cluster = {low, node, interface, health, high};
  EXPECT_THAT(host::difference({}, cluster).changed,
              ElementsAre(health, interface, node, low, high));
  EXPECT_THAT(host::difference(cluster, {}).removed,
              ElementsAre(low, high, node, interface, health));
  const auto news = host::difference(cluster, {low, entry(3, "a1", 1), interface, health});
  EXPECT_THAT(news.changed, ElementsAre(entry(3, "a1", 1)));
  EXPECT_THAT(news.removed, ElementsAre(high));
}

/* ---- Reloads --------------------------------------------------------------------------------- */

/* A file in a folder of its own, its source, and what the source's watch reports. */
class ClusterFileReload : public Test {
 protected:
  ClusterFileReload() {
    std::filesystem::create_directory(folder_);
    source_.emplace(path(), directory_);
  }
  ~ClusterFileReload() override {
    source_.reset();
    std::filesystem::remove_all(folder_);
  }

  std::string path(const char *name = "cluster.json") const { return folder_ / name; }
  void write(const std::string &text, const char *name = "cluster.json") const {
    std::ofstream(path(name)) << expand(text);
  }
  /* Waits for the next report of the watch. */
  host::Reload next() {
    std::unique_lock lock(mutex_);
    const bool told =
        told_.wait_for(lock, std::chrono::minutes(1), [&] { return !reports_.empty(); });
    if (!told) throw std::runtime_error("nothing was reported");
    host::Reload report = reports_.front();
    reports_.pop_front();
    return report;
  }
  void watch() {
    source_->watch([&](const host::Reload &report) {
      const std::lock_guard lock(mutex_);
      reports_.push_back(report);
      told_.notify_all();
    });
  }
  std::string heldHealth() const {
    return shown(directory_.entries(KARST_TYPE_HEALTH_STATUS).at(0));
  }

  const LogLines log_;
  const std::filesystem::path folder_{TempDir() + "cluster." + std::to_string(getpid())};
  host::Directory directory_;
  std::mutex mutex_;
  std::condition_variable told_;
  std::deque<host::Reload> reports_;
  std::optional<host::ClusterFileSource> source_;
  const std::string good_ = interface(R"("healthy":true)"), bad_ = interface(R"("healthy":false)");
};

TEST_F(ClusterFileReload, SubscribersHearOfTheDifferenceAlone) {
  std::string heard; /* by the one delivery thread; read while it is idle */
  KarstQuery query{};
  query.type = KARST_TYPE_NET_INTERFACE;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL | KARST_QUERY_REPLICA;
  const KarstSubscriptionFn listen = [](void *to, const KarstEntryHeader *header, void *,
                                        zel_Status status) -> zel_Status {
    if (status == ZEL_SUB_CANCELLED) return ZEL_OK;
    *static_cast<std::string *>(to) +=
        (status == ZEL_OK ? "+" : "-") + toString(header->uuid).substr(34);
    return ZEL_OK;
  };
  const auto load = [&](const char *interfaces) {
    write(node(std::string("\"interfaces\":[") + interfaces + "]"));
    source_->load();
    directory_.waitUntilIdle();
  };
  ASSERT_EQ(directory_.subscribe(&query, listen, &heard), ZEL_OK);
  directory_.put({KARST_TYPE_NET_INTERFACE, uuid("b9"), uuid("a9"), {}}); /* another source's */
  load(R"({"uuid":@b1},{"uuid":@b2},{"uuid":@b3})");
  load(R"({"uuid":@b4},{"uuid":@b2,"ipv4":"192.0.2.1"},{"uuid":@b1})");
  EXPECT_EQ(heard, "+b9+b1+b2+b3-b3+b2+b4");
  directory_.unsubscribe(&query, listen, &heard);
  directory_.waitUntilIdle();
}

TEST_F(ClusterFileReload, AWatchedFileIsReadHoweverItChangesAndEachRefusalReportedOnce) {
  write(good_);
  source_->load();
  write(bad_); /* between load and watch */
  watch();
  EXPECT_EQ(next().difference.changed.size(), 1u);
  EXPECT_EQ(heldHealth(), "health b1 of a1: 1");

  write(good_, "new");
  std::filesystem::rename(path("new"), path());
  EXPECT_EQ(next().difference.changed.size(), 1u);
  write(bad_); /* the watch did not go with the file that was replaced */
  EXPECT_EQ(next().difference.changed.size(), 1u);

  write("{");
  EXPECT_THAT(next().refusal, HasSubstr("cluster.json:1:2: no valid JSON"));
  EXPECT_EQ(heldHealth(), "health b1 of a1: 1");
  EXPECT_EQ(source_->content().entries.size(), 3u);
  EXPECT_THROW(source_->load(), host::ClusterFileError);
  write(bad_); /* as before the refusal: good again is news even so */
  EXPECT_EQ(next().refusal, "");

  std::filesystem::rename(path(), path("aside"));
  EXPECT_THAT(next().refusal, HasSubstr("the file is gone"));
  EXPECT_EQ(heldHealth(), "health b1 of a1: 1");
  write(good_, "aside");
  std::filesystem::rename(path("aside"), path());
  EXPECT_EQ(next().difference.changed.size(), 1u);
  EXPECT_EQ(heldHealth(), "health b1 of a1: 0");
}

TEST_F(ClusterFileReload, AFolderThatCannotBeWatchedIsAnError) {
  std::filesystem::remove_all(folder_);
  EXPECT_THROW(watch(), std::system_error);
}

/* ---- UUIDs that are not stored --------------------------------------------------------------- */

TEST(MachineUUID, IsTheMachineIdOrACallForAnotherSource) {
  const std::string path = TempDir() + "machine-id." + std::to_string(getpid());
  std::ofstream(path) << "00112233445566778899aabbccddeeff\n";
  EXPECT_EQ(toString(host::machineUUID(path)), "00112233-4455-6677-8899-aabbccddeeff");
  for (const char *text : {"", "uninitialized\n", "00000000000000000000000000000000\n"}) {
    std::ofstream(path) << text;
    EXPECT_THAT([&] { host::machineUUID(path); },
                ThrowsMessage<std::runtime_error>(HasSubstr("--self")));
  }
}

TEST(NamedUUID, FollowsFromOwnerAndNameAlone) { /* the standard's own example */
  const zel_UUID dns = host::parseUUID("6ba7b810-9dad-11d1-80b4-00c04fd430c8").value();
  EXPECT_EQ(toString(host::namedUUID(dns, "www.example.com")),
            "2ed6657d-e927-568b-95e1-2665a8aea6a2");
}

/* ---- This machine's interfaces --------------------------------------------------------------- */

host::OwnAddress own(const std::string &text, bool local = false, bool passing = false) {
  host::OwnAddress result{{}, local, passing};
  result.address.isIPv6 = text.find(':') != std::string::npos;
  inet_pton(result.address.isIPv6 ? AF_INET6 : AF_INET, text.c_str(), result.address.address);
  return result;
}

TEST(OwnInterfaces, SevenAddressesComeInAnOrderThatDoesNotDependOnTheSystem) {
  const LogLines log;
  host::OwnInterface eth0{"eth0", {}, false, true, {own("fe80::1", true)}};
  for (const char *text : {"2001:db8::9", "192.0.2.1"}) { /* passing ones */
    eth0.addresses.push_back(own(text, false, true));
  }
  for (const char *text :
       {"2001:db8::1", "192.0.2.9", "192.0.2.4", "192.0.2.8", "192.0.2.7", "192.0.2.6"}) {
    eth0.addresses.push_back(own(text));
  }
  for (int turn = 1; turn <= 2; turn++) {
    EXPECT_EQ(textOf(host::publishedAddresses(eth0)),
              " 192.0.2.4 192.0.2.6 192.0.2.7 192.0.2.8 192.0.2.9 2001:db8::1 192.0.2.1");
    std::reverse(eth0.addresses.begin(), eth0.addresses.end());
  }
  EXPECT_THAT(log.texts,
              ElementsAre("interface eth0 has 8 addresses: the first 7 are published", _));
}

TEST(OwnInterfaces, ANodeIsPublishedWithItsInterfacesAndTheirCarriersAsHealth) {
  const std::vector<host::OwnInterface> interfaces = {
      {"lo", {}, true, true, {own("127.0.0.1", true)}},
      {"eth0", {2, 0, 0, 0, 0, 1}, false, true, {own("192.0.2.1")}},
      {"eth1", {2, 0, 0, 0, 0, 2}, false, false, {own("2001:db8::1")}},
      {"eth2", {2, 0, 0, 0, 0, 3}, false, true, {own("fe80::1", true)}}};
  host::OwnNode node{.uuid = uuid("a1"), .majorVersion = 3, .witness = true};
  const std::string eth0 = endOf(host::namedUUID(node.uuid, "eth0")) + " of a1: ";
  const std::string eth1 = endOf(host::namedUUID(node.uuid, "eth1")) + " of a1: ";
  const auto entries = host::entriesOf(node, interfaces);
  EXPECT_TRUE(std::is_sorted(entries.begin(), entries.end(), host::comesBefore));
  const std::string before = ", ports 0 0, TTL 0, bandwidth 0, MAC 02000000000";
  const std::string behind = ", groups :: ::, traffic 0";
  EXPECT_THAT(shown(entries),
              UnorderedElementsAre(
                  "node a1 of a1: 3.0 flags 2", "health " + eth0 + "0", "health " + eth1 + "1",
                  "interface " + eth0 + "type 1, 0.0.0.0, 192.0.2.1" + before + "1" + behind,
                  "interface " + eth1 + "type 1, 0.0.0.0, 2001:db8::1" + before + "2" + behind));
  node.includeLoopback = true;
  EXPECT_EQ(host::entriesOf(node, interfaces).size(), 7u);
}

}  // namespace
