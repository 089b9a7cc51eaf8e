/* What feeds the directory: what a cluster file becomes (what is refused: transcripts/refusals.txt),
 * what the directory is told of it, and this machine's own interfaces.
 */
#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "host/directory/records.h"
#include "host/sources/cluster_file_source.h"
#include "host/sources/machine_uuid.h"
#include "host/sources/own_interfaces_source.h"
#include "host/sources/published_entries.h"
#include "tests/log_lines.h"

namespace {

using host::Entry;
using host::toString;
using namespace testing;

/* UUIDs that end in two digits of choice. */
const std::string begin = "00000000-0000-4000-8000-0000000000";

zel_UUID uuid(const std::string &end) {
  return host::parseUUID(begin + end).value();
}
Entry node(const char *end, const KarstNodeEntry &record) {
  return {KARST_TYPE_NODE, uuid(end), uuid(end), host::encode(record)};
}
Entry health(const zel_UUID &netIf, const char *owner, uint32_t flags) {
  KarstHealthStatusEntry record{};
  record.healthFlags = flags;
  return {KARST_TYPE_HEALTH_STATUS, netIf, uuid(owner), host::encode(record)};
}
Entry interface(const zel_UUID &netIf, const char *owner, KarstNetInterfaceEntry record = {}) {
  record.networkType = KARST_NETWORK_TYPE_IP;
  return {KARST_TYPE_NET_INTERFACE, netIf, uuid(owner), host::encode(record)};
}
KarstIpAddress address(const std::string &text) {
  KarstIpAddress result{};
  result.isIPv6 = text.find(':') != std::string::npos;
  EXPECT_EQ(inet_pton(result.isIPv6 ? AF_INET6 : AF_INET, text.c_str(), result.address), 1);
  return result;
}

/* ---- The cluster file ------------------------------------------------------------------------ */

/* What is seen of them in an answer: transcripts/resolve.txt. */
TEST(ClusterFile, FieldsThatNoAnswerShowsBecomeEntriesAllTheSame) {
  const auto content = host::parseClusterText(
      R"({"$schema":"cluster.schema.json",
          "nodes":[{"uuid":"00000000-0000-4000-8000-0000000000a2",
            "interfaces":[{"uuid":"00000000-0000-4000-8000-0000000000b1",
              "addresses":["2001:db8::7"], "ipv4":"198.51.100.7", "trafficTypes":[0,1,63],
              "mac":"02:00:00:00:0a:FF", "bandwidth":9223372036854775807,
              "agentGroupPort":12345, "masterGroupPort":23451, "multicastTTL":5,
              "agentV6Group":"ff02::2", "masterV6Group":"ff02::1",
              "healthy":false, "healthFlags":6},
             {"uuid":"00000000-0000-4000-8000-0000000000b2", "healthy":false}]}]})",
      "c.json");
  const KarstNetInterfaceEntry whole{
      .networkType = 1,
      .ipv4Address = {198, 51, 100, 7},
      .networkPart = {},
      .agentGroupPort = 12345,
      .masterGroupPort = 23451,
      .multicastTTL = 5,
      .bandwidth = INT64_MAX,
      .macAddress = {2, 0, 0, 0, 0x0a, 0xff},
      .agentV6Group = {0xff, 2, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 2},
      .masterV6Group = {0xff, 2, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1},
      .padding = {},
      .numIpAddresses = 1,
      .ipAddresses = {address("2001:db8::7")},
      .trafficTypeMask = 0x8000000000000003,
  };
  const zel_UUID b1 = uuid("b1"), b2 = uuid("b2");
  EXPECT_THAT(content.entries,
              ElementsAre(node("a2", {}), interface(b1, "a2", whole), interface(b2, "a2"),
                          health(b1, "a2", 6), health(b2, "a2", 1)));
}

/* How a watch reads it however it changes: transcripts/watch.txt. */
TEST(ClusterFile, AChangeBetweenLoadAndWatchIsSeen) {
  const std::string path = TempDir() + "cluster." + std::to_string(getpid());
  host::Directory directory;
  host::ClusterFileSource source(path, directory);
  std::ofstream(path) << R"({"nodes":[]})";
  source.load();
  std::ofstream(path) << R"({"nodes":[{"uuid":")" << begin << R"(a1"}]})";
  size_t changed = 0;
  source.watch([&](const host::Reload &report) { changed += report.difference.changed.size(); });
  EXPECT_EQ(changed, 1u);
  EXPECT_THAT(directory.entries(KARST_TYPE_NODE), ElementsAre(node("a1", {})));
}

/* ---- What the directory is told -------------------------------------------------------------- */

TEST(PublishedEntries, AreBuiltFromTheGroundUpTakenDownFromTheTopAndOtherwiseLeftAlone) {
  const auto entry = [](uint8_t type, const char *end, uint8_t data = 0) {
    return Entry{type, uuid(end), uuid("a1"), {data}};
  };
  const Entry low = entry(0, "c1"), node = entry(3, "a1"), first = entry(6, "b1"),
              second = entry(6, "b2"), health = entry(7, "b1"), high = entry(9, "c2"),
              others = entry(6, "b9"), changed = entry(3, "a1", 1);
  host::Directory directory({1, 16});
  directory.put(others);
  std::string heard; /* of interfaces; to be read while the directory is idle */
  KarstQuery query{};
  query.type = KARST_TYPE_NET_INTERFACE;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL | KARST_QUERY_REPLICA;
  const KarstSubscriptionFn listen = [](void *to, const KarstEntryHeader *header, void *,
                                        zel_Status status) -> zel_Status {
    const char *what = status == ZEL_OK ? "+" : status == ZEL_NOT_FOUND ? "-" : "end ";
    *static_cast<std::string *>(to) += what + toString(header->uuid).substr(34);
    return ZEL_OK;
  };
  ASSERT_EQ(directory.subscribe(&query, listen, &heard), ZEL_OK);
  host::PublishedEntries published(directory);
  EXPECT_THAT(published.replace({low, node, first, health, high}).changed,
              ElementsAre(health, first, node, low, high));
  const auto news = published.replace({low, changed, second, health});
  EXPECT_THAT(news.changed, ElementsAre(second, changed));
  EXPECT_THAT(news.removed, ElementsAre(high, first));
  directory.waitUntilIdle();
  EXPECT_EQ(heard, "+b9+b1-b1+b2") << "what goes makes room first";
  EXPECT_THAT(published.replace({}).removed, ElementsAre(low, changed, second, health));
  directory.unsubscribe(&query, listen, &heard);
  directory.waitUntilIdle();
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
  return {address(text), local, passing};
}

TEST(OwnInterfaces, SevenAddressesComeInAnOrderThatDoesNotDependOnTheSystem) {
  const LogLines log;
  host::OwnInterface eth0{"eth0", {}, false, true, {own("fe80::1", true)}};
  const char *const lasting[] = {"192.0.2.4", "192.0.2.6", "192.0.2.7",
                                 "192.0.2.8", "192.0.2.9", "2001:db8::1"};
  for (const char *text : lasting) eth0.addresses.push_back(own(text));
  eth0.addresses.push_back(own("192.0.2.1", false, true));
  eth0.addresses.push_back(own("2001:db8::9", false, true));
  std::reverse(eth0.addresses.begin(), eth0.addresses.end());
  const auto published = host::publishedAddresses(eth0);
  ASSERT_EQ(published.size(), 7u);
  for (size_t i = 0; i < 7; i++) {
    const KarstIpAddress expected = address(i < 6 ? lasting[i] : "192.0.2.1");
    EXPECT_EQ(std::memcmp(&published[i], &expected, sizeof expected), 0) << i;
  }
  EXPECT_THAT(log.texts, ElementsAre("interface eth0 has 8 addresses: the first 7 are published"));
}

TEST(OwnInterfaces, ANodeIsPublishedWithItsInterfacesAndTheirCarriersAsHealth) {
  const std::vector<host::OwnInterface> interfaces = {
      {"lo", {}, true, true, {own("127.0.0.1", true)}},
      {"eth1", {2, 0, 0, 0, 0, 2}, false, false, {own("2001:db8::1")}},
      {"eth2", {2, 0, 0, 0, 0, 3}, false, true, {own("fe80::1", true)}}};
  host::OwnNode self{.uuid = uuid("a1"), .majorVersion = 3, .witness = true};
  const zel_UUID eth1 = host::namedUUID(self.uuid, "eth1");
  KarstNetInterfaceEntry record{};
  record.macAddress[0] = record.macAddress[5] = 2;
  record.numIpAddresses = 1;
  record.ipAddresses[0] = address("2001:db8::1");
  EXPECT_THAT(host::entriesOf(self, interfaces),
              ElementsAre(node("a1", {3, 0, KARST_NODE_FLAG_WITNESS, 0, 0}),
                          interface(eth1, "a1", record), health(eth1, "a1", 1)));
  self.includeLoopback = true;
  EXPECT_EQ(host::entriesOf(self, interfaces).size(), 5u);
}

}  // namespace
