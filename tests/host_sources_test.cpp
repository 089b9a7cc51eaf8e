/* What feeds the directory: the cluster file with its rules and its reloads, and this machine's own
 * interfaces.
 */
#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <set>
#include <sstream>

#include "host/directory/records.h"
#include "host/kernel/log.h"
#include "host/sources/cluster_file_source.h"
#include "host/sources/machine_uuid.h"
#include "host/sources/own_interfaces_source.h"

namespace {

using host::Entry;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

/* ---- Shorthand: UUIDs that end in two digits of choice --------------------------------------- */

std::string uuidText(const std::string &end) {
  return "00000000-0000-4000-8000-0000000000" + end;
}
zel_UUID uuid(const std::string &end) {
  return host::parseUUID(uuidText(end)).value();
}

/* @a1 stands for the UUID that ends in a1, in quotation marks, $a1 for the same without. */
std::string expand(const std::string &text) {
  std::string result;
  for (size_t i = 0; i < text.size(); i++) {
    const bool mark = text[i] == '@' || text[i] == '$';
    if (mark && i + 2 < text.size() && isxdigit(text[i + 1]) && isxdigit(text[i + 2])) {
      const std::string whole = uuidText(text.substr(i + 1, 2));
      result += text[i] == '@' ? '"' + whole + '"' : whole;
      i += 2;
    } else {
      result += text[i];
    }
  }
  return result;
}

host::ClusterContent parse(const std::string &text) {
  return host::parseClusterText(expand(text), "c.json");
}

/* An interface of an otherwise good file, with these fields beside its UUID. */
std::string withInterface(const std::string &fields) {
  return R"({"nodes":[{"uuid":@a1,"interfaces":[{"uuid":@b1,)" + fields + "}]}]}";
}

const Entry &find(const std::vector<Entry> &entries, uint8_t type, const std::string &end) {
  for (const Entry &entry : entries) {
    if (entry.type == type && entry.uuid == uuid(end)) return entry;
  }
  throw std::out_of_range("no entry of type " + std::to_string(type) + " with UUID ..." + end);
}

template <typename Record>
Record decoded(const std::vector<Entry> &entries, uint8_t type, const std::string &end) {
  Record record{};
  EXPECT_EQ(host::decode(find(entries, type, end).data, &record), ZEL_OK);
  return record;
}

std::string addressText(const KarstIpAddress &address) {
  char text[INET6_ADDRSTRLEN];
  return inet_ntop(address.isIPv6 ? AF_INET6 : AF_INET, address.address, text, sizeof text);
}

std::vector<std::string> addressTexts(const KarstNetInterfaceEntry &record) {
  std::vector<std::string> texts;
  for (uint32_t i = 0; i < record.numIpAddresses; i++) {
    texts.push_back(addressText(record.ipAddresses[i]));
  }
  return texts;
}

/* ---- The cluster file: what is refused, where, and in which words ---------------------------- */

struct RefusalCase {
  const char *name;
  std::string text;
  std::string message;
};

class ClusterFileRefusal : public testing::TestWithParam<RefusalCase> {};

TEST_P(ClusterFileRefusal, NamesPlaceAndRule) {
  try {
    parse(GetParam().text);
    FAIL() << "was taken in";
  } catch (const host::ClusterFileError &error) {
    EXPECT_EQ(error.what(), expand(GetParam().message));
  }
}

const char uuidRule[] = "; expected: A UUID: 32 hexadecimal digits, plain or as 8-4-4-4-12";
const char objectFields[] = R"("type":9,"uuid":@c1,"owner":@a1)";

const RefusalCase refusalCases[] = {
    /* No JSON: line and column */
    {"EmptyFile", "",
     "c.json:1:1: no valid JSON: syntax error while parsing value - unexpected end of input; "
     "expected '[', '{', or a literal"},
    {"MissingComma", "{\n  \"nodes\": [\n    {} {}\n  ]\n}",
     "c.json:3:8: no valid JSON: syntax error while parsing array - unexpected '{'; expected ']'"},
    {"FieldTwice", R"({"nodes":[{"uuid":@a1},{"uuid":@a2,"interfaces":[],"uuid":@a3}]})",
     "c.json: /nodes/1: field \"uuid\" is given twice; keep one of the two"},
    {"FieldTwiceAtTheTop", R"({"nodes":[],"nodes":[]})",
     "c.json: top level: field \"nodes\" is given twice; keep one of the two"},
    /* Structure */
    {"NoObject", "[]",
     "c.json: top level: wrong type (array); expected: An object with the fields self, nodes and "
     "objects: what the cluster directory holds"},
    {"NodesMissing", "{}",
     "c.json: top level: missing field \"nodes\"; expected: The cluster's nodes: an array of "
     "objects"},
    {"UnknownField", R"({"nodes":[{"uuid":@a1},{"uuid":@a2,"colour":"red"}]})",
     "c.json: /nodes/1: unknown field \"colour\"; known here: interfaces, name, rawRecord, uuid, "
     "version, witness"},
    {"MisspeltInterfaceField", withInterface(R"("adresses":[])"),
     "c.json: /nodes/0/interfaces/0: unknown field \"adresses\"; known here: addresses, "
     "agentGroupPort, agentV6Group, bandwidth, healthFlags, healthy, ipv4, mac, masterGroupPort, "
     "masterV6Group, multicastTTL, name, networkType, rawRecord, trafficTypes, uuid"},
    {"WrongType", R"({"nodes":[{"uuid":@a1,"witness":"yes"}]})",
     "c.json: /nodes/0/witness: wrong type (string); expected: Whether the node is a witness, "
     "reached by traffic of type 1: true or false"},
    {"HalfAVersion", R"({"nodes":[{"uuid":@a1,"version":{"major":2}}]})",
     "c.json: /nodes/0/version: missing field \"minor\"; expected: A whole number from 0 to "
     "4294967295"},
    {"NegativeNumber", R"({"nodes":[{"uuid":@a1,"version":{"major":-2,"minor":0}}]})",
     "c.json: /nodes/0/version/major: -2 is refused; expected: A whole number from 0 to "
     "4294967295"},
    {"NumberBeyond32Bits", withInterface(R"("multicastTTL":4294967296)"),
     "c.json: /nodes/0/interfaces/0/multicastTTL: 4294967296 is refused; expected: A whole number "
     "from 0 to 4294967295"},
    {"NumberBeyond63Bits", withInterface(R"("bandwidth":9223372036854775808)"),
     "c.json: /nodes/0/interfaces/0/bandwidth: 9223372036854775808 is refused; expected: The "
     "bandwidth in bits a second: a whole number from 0 to 9223372036854775807"},
    {"NumberBeyond64Bits", withInterface(R"("bandwidth":18446744073709551616)"),
     "c.json: /nodes/0/interfaces/0/bandwidth: 1.8446744073709552e+19 is refused; expected: The "
     "bandwidth in "
     "bits "
     "a second: a whole number from 0 to 9223372036854775807"},
    {"LongName",
     R"({"nodes":[{"uuid":@a1,"name":"01234567890123456789012345678901234567890123456789012345678901234"}]})",
     "c.json: /nodes/0/name: too long "
     "(\"01234567890123456789012345678901234567890123456789012345678"
     "...); expected: A name for people, shown beside the UUID: text of at most 64 characters"},
    /* UUIDs */
    {"BadUUID", R"({"nodes":[{"uuid":"node-1"}]})",
     std::string("c.json: /nodes/0/uuid: \"node-1\" is refused") + uuidRule},
    {"UUIDWithAHyphenTooFew", R"({"nodes":[{"uuid":"00000000-0000-4000-80000000000000a1"}]})",
     std::string("c.json: /nodes/0/uuid: \"00000000-0000-4000-80000000000000a1\" is refused") +
         uuidRule},
    {"ZeroUUID", R"({"self":"00000000-0000-0000-0000-000000000000","nodes":[]})",
     "c.json: /self: \"00000000-0000-0000-0000-000000000000\" is refused; expected: a UUID other "
     "than the all-zero one, which stands for none"},
    {"NodeTwice", R"({"nodes":[{"uuid":@a1},{"uuid":@a2},{"uuid":@a1}]})",
     "c.json: /nodes/2/uuid: node $a1 is there already, at /nodes/0; give each its own UUID"},
    {"InterfaceTwiceUnderTwoNodes",
     R"({"nodes":[{"uuid":@a1,"interfaces":[{"uuid":@b1}]},
                  {"uuid":@a2,"interfaces":[{"uuid":@b2},{"uuid":@b1}]}]})",
     "c.json: /nodes/1/interfaces/1/uuid: interface $b1 is there already, at "
     "/nodes/0/interfaces/0; give each its own UUID"},
    {"ObjectTwice",
     std::string(R"({"nodes":[{"uuid":@a1}],"objects":[{)") + objectFields + "},{" + objectFields +
         "}]}",
     "c.json: /objects/1/uuid: an object of this type and UUID, $c1 is there already, at "
     "/objects/0; give each its own UUID"},
    /* Addresses */
    {"EightAddresses",
     withInterface(R"("addresses":["::1","::2","::3","::4","::5","::6","::7","::8"])"),
     "c.json: /nodes/0/interfaces/0/addresses: too many items (8); expected: The interface's "
     "addresses, the preferred first: an array of at most 7"},
    {"NoAddress", withInterface(R"("addresses":["192.0.2.1","192.0.2.300"])"),
     "c.json: /nodes/0/interfaces/0/addresses/1: \"192.0.2.300\" is no address; expected: IPv4, "
     "such as \"192.0.2.1\", or IPv6, such as \"2001:db8::1\", without a prefix length"},
    {"AddressWithPrefixLength", withInterface(R"("addresses":["2001:db8::1/64"])"),
     "c.json: /nodes/0/interfaces/0/addresses/0: \"2001:db8::1/64\" is no address; expected: IPv4, "
     "such as \"192.0.2.1\", or IPv6, such as \"2001:db8::1\", without a prefix length"},
    {"AddressOfTheOtherFamily", withInterface(R"("ipv4":"2001:db8::1")"),
     "c.json: /nodes/0/interfaces/0/ipv4: \"2001:db8::1\" is no IPv4 address; expected: such as "
     "\"192.0.2.1\""},
    {"GroupOfTheOtherFamily", withInterface(R"("masterV6Group":"224.2.3.4")"),
     "c.json: /nodes/0/interfaces/0/masterV6Group: \"224.2.3.4\" is no IPv6 address; expected: "
     "such "
     "as \"ff02::1\""},
    {"IPv4OnAnotherNetworkType", withInterface(R"("networkType":2,"ipv4":"192.0.2.1")"),
     "c.json: /nodes/0/interfaces/0/ipv4: only an interface of networkType 1 has this address; "
     "leave it out"},
    {"BadMAC", withInterface(R"("mac":"02-00-00-00-00-01")"),
     "c.json: /nodes/0/interfaces/0/mac: \"02-00-00-00-00-01\" is refused; expected: The MAC "
     "address: 6 pairs of hexadecimal digits with colons between"},
    /* Traffic types, health, raw records */
    {"TrafficType64", withInterface(R"("trafficTypes":[0,64])"),
     "c.json: /nodes/0/interfaces/0/trafficTypes/1: 64 is refused; expected: A type of traffic: a "
     "whole number from 0 to 63"},
    {"NoTrafficType", withInterface(R"("trafficTypes":[])"),
     "c.json: /nodes/0/interfaces/0/trafficTypes: too few items (0); expected: The types of "
     "traffic "
     "carried, each once: at least one whole number from 0 to 63; leave the field out for all of "
     "them"},
    {"TrafficTypeTwice", withInterface(R"("trafficTypes":[1,1])"),
     "c.json: /nodes/0/interfaces/0/trafficTypes: [1,1] is refused; expected: The types of traffic "
     "carried, each once: at least one whole number from 0 to 63; leave the field out for all of "
     "them"},
    {"FlagsOfAHealthyInterface", withInterface(R"("healthFlags":2)"),
     "c.json: /nodes/0/interfaces/0/healthFlags: only an interface with \"healthy\": false has "
     "these flags; leave one of the two out or make the interface unhealthy"},
    {"RawRecordAndItsFields", withInterface(R"("rawRecord":"a0","mac":"02:00:00:00:00:01")"),
     "c.json: /nodes/0/interfaces/0: field \"mac\" beside \"rawRecord\", which stands in for the "
     "whole record; leave out one of the two"},
    {"OddHex", R"({"nodes":[{"uuid":@a1,"rawRecord":"a0f"}]})",
     "c.json: /nodes/0/rawRecord: \"a0f\" is refused; expected: hexadecimal digits in pairs"},
    /* Objects */
    {"OwnerMissing", R"({"nodes":[],"objects":[{"type":9,"uuid":@c1}]})",
     "c.json: /objects/0: missing field \"owner\"; expected: The node that owns the object: a "
     "UUID, "
     "32 hexadecimal digits, plain or as 8-4-4-4-12"},
    {"OwnerUnknown", R"({"nodes":[{"uuid":@a1}],"objects":[{"type":9,"uuid":@c1,"owner":@a9}]})",
     "c.json: /objects/0/owner: node $a9 is not in this file; expected: the UUID of one of its "
     "nodes or its \"self\""},
    {"ObjectOfTheNodesType",
     R"({"nodes":[{"uuid":@a1}],"objects":[{"type":3,"uuid":@c1,"owner":@a1}]})",
     "c.json: /objects/0/type: 3 is refused; expected: The object's entry type: a whole number "
     "from "
     "0 to 255, but not 3, 6 or 7, which the directory keeps for nodes, interfaces and health"},
};

INSTANTIATE_TEST_SUITE_P(, ClusterFileRefusal, testing::ValuesIn(refusalCases),
                         [](const auto &row) { return row.param.name; });

TEST(ClusterFileRefusals, AFileThatCannotBeReadIsNamedWithTheReason) {
  EXPECT_THROW(
      try {
        host::parseClusterFile("/nonexistent/c.json");
      } catch (const host::ClusterFileError &error) {
        EXPECT_STREQ(error.what(),
                     "/nonexistent/c.json: cannot be opened: No such file or directory");
        throw;
      },
      host::ClusterFileError);
  EXPECT_THROW(host::parseClusterFile("/"), host::ClusterFileError);
}

/* ---- The cluster file: what a good one means ------------------------------------------------- */

TEST(ClusterFile, NodesBecomeEntriesThatOwnThemselves) {
  const auto content = parse(R"({"$schema":"cluster.schema.json","self":@a2,"nodes":[
      {"uuid":@a2,"name":"beta","version":{"major":7,"minor":4294967295},"witness":true},
      {"uuid":@a1}]})");
  EXPECT_EQ(content.self, uuid("a2"));
  EXPECT_THAT(content.names, ElementsAre(std::pair(uuid("a2"), "beta")));
  ASSERT_EQ(content.entries.size(), 2u);
  EXPECT_EQ(content.entries[0].uuid, uuid("a1"));
  EXPECT_EQ(content.entries[1].owner, uuid("a2"));
  const auto plain = decoded<KarstNodeEntry>(content.entries, KARST_TYPE_NODE, "a1");
  EXPECT_EQ(plain.majorVersionNum, 0u);
  EXPECT_EQ(plain.flags, 0u);
  const auto witness = decoded<KarstNodeEntry>(content.entries, KARST_TYPE_NODE, "a2");
  EXPECT_EQ(witness.majorVersionNum, 7u);
  EXPECT_EQ(witness.minorVersionNum, 4294967295u);
  EXPECT_EQ(witness.flags, KARST_NODE_FLAG_WITNESS);
}

TEST(ClusterFile, EveryFieldOfAnInterfaceReachesItsRecord) {
  const auto content = parse(withInterface(R"(
      "networkType":1, "addresses":["2001:db8::7","192.0.2.7"], "ipv4":"198.51.100.7",
      "trafficTypes":[0,1,63], "mac":"02:00:5e:10:0a:FF", "bandwidth":9223372036854775807,
      "agentGroupPort":12345, "masterGroupPort":23451, "multicastTTL":5,
      "agentV6Group":"ff02::2:3:4", "masterV6Group":"ff02::1:2:3")"));
  EXPECT_EQ(find(content.entries, KARST_TYPE_NET_INTERFACE, "b1").owner, uuid("a1"));
  const auto record =
      decoded<KarstNetInterfaceEntry>(content.entries, KARST_TYPE_NET_INTERFACE, "b1");
  EXPECT_EQ(record.networkType, 1u);
  EXPECT_THAT(addressTexts(record), ElementsAre("2001:db8::7", "192.0.2.7"));
  EXPECT_THAT(record.ipv4Address, ElementsAre(198, 51, 100, 7));
  EXPECT_EQ(record.trafficTypeMask, 0x8000000000000003u);
  EXPECT_THAT(record.macAddress, ElementsAre(0x02, 0x00, 0x5e, 0x10, 0x0a, 0xff));
  EXPECT_EQ(record.bandwidth, 9223372036854775807u);
  EXPECT_EQ(record.agentGroupPort, 12345u);
  EXPECT_EQ(record.masterGroupPort, 23451u);
  EXPECT_EQ(record.multicastTTL, 5u);
  EXPECT_EQ(record.agentV6Group[5], 0x00);
  EXPECT_EQ(record.agentV6Group[15], 0x04);
  EXPECT_EQ(record.masterV6Group[13], 0x02);
}

TEST(ClusterFile, AnInterfaceLeftToItsDefaultsIsIPForAllTrafficAndHealthy) {
  const auto content = parse(withInterface(R"("name":"eth0")"));
  const auto record =
      decoded<KarstNetInterfaceEntry>(content.entries, KARST_TYPE_NET_INTERFACE, "b1");
  EXPECT_EQ(record.networkType, KARST_NETWORK_TYPE_IP);
  EXPECT_EQ(record.trafficTypeMask, 0u);
  EXPECT_EQ(record.numIpAddresses, 0u);
  EXPECT_EQ(find(content.entries, KARST_TYPE_HEALTH_STATUS, "b1").owner, uuid("a1"));
  EXPECT_EQ(
      decoded<KarstHealthStatusEntry>(content.entries, KARST_TYPE_HEALTH_STATUS, "b1").healthFlags,
      0u);
}

TEST(ClusterFile, HealthIsGoodBadOrUnknown) {
  const auto flags = [](const std::string &fields) {
    return decoded<KarstHealthStatusEntry>(parse(withInterface(fields)).entries,
                                           KARST_TYPE_HEALTH_STATUS, "b1")
        .healthFlags;
  };
  EXPECT_EQ(flags(R"("healthy":true)"), 0u);
  EXPECT_EQ(flags(R"("healthy":false)"), 1u);
  EXPECT_EQ(flags(R"("healthy":false,"healthFlags":6)"), 6u);
  EXPECT_THROW(
      find(parse(withInterface(R"("healthy":null)")).entries, KARST_TYPE_HEALTH_STATUS, "b1"),
      std::out_of_range);
}

TEST(ClusterFile, RawRecordsGoIntoTheDirectoryAsTheyAre) {
  const auto content = parse(R"({"nodes":[{"uuid":@a1,"rawRecord":"00fF",
                                  "interfaces":[{"uuid":@b1,"rawRecord":""}]}]})");
  EXPECT_THAT(find(content.entries, KARST_TYPE_NODE, "a1").data, ElementsAre(0x00, 0xff));
  EXPECT_THAT(find(content.entries, KARST_TYPE_NET_INTERFACE, "b1").data, IsEmpty());
}

TEST(ClusterFile, ObjectsMayShareAUUIDAcrossTypesAndBelongToSelf) {
  const auto content = parse(R"({"self":@a9,"nodes":[{"uuid":@a1}],"objects":[
      {"type":255,"uuid":@c1,"owner":@a9,"name":"volume"},{"type":0,"uuid":@c1,"owner":@a1}]})");
  EXPECT_EQ(find(content.entries, 0, "c1").owner, uuid("a1"));
  EXPECT_EQ(find(content.entries, 255, "c1").owner, uuid("a9"));
  EXPECT_EQ(content.names.at(uuid("c1")), "volume");
}

TEST(ClusterFile, TheExampleShowsEverythingThatItIsThereToShow) {
  const auto content = host::parseClusterFile(CLUSTER_EXAMPLE);
  size_t nodes = 0, witnesses = 0, unhealthy = 0, ipv4Only = 0, ipv4 = 0, ipv6 = 0;
  std::set<zel_UUID> healthyNodes;
  std::set<unsigned> objectTypes;
  for (const Entry &entry : content.entries) {
    KarstNodeEntry node{};
    KarstNetInterfaceEntry interface {};
    KarstHealthStatusEntry health{};
    if (entry.type == KARST_TYPE_NODE) {
      nodes++;
      EXPECT_EQ(content.names.count(entry.uuid), 1u);
      ASSERT_EQ(host::decode(entry.data, &node), ZEL_OK);
      witnesses += node.flags == KARST_NODE_FLAG_WITNESS;
    } else if (entry.type == KARST_TYPE_NET_INTERFACE) {
      ASSERT_EQ(host::decode(entry.data, &interface), ZEL_OK);
      ipv4Only += interface.numIpAddresses == 0 && interface.ipv4Address[0] != 0;
      for (uint32_t i = 0; i < interface.numIpAddresses; i++) {
        (interface.ipAddresses[i].isIPv6 ? ipv6 : ipv4)++;
      }
    } else if (entry.type == KARST_TYPE_HEALTH_STATUS) {
      ASSERT_EQ(host::decode(entry.data, &health), ZEL_OK);
      unhealthy += health.healthFlags != 0;
      if (health.healthFlags == 0) healthyNodes.insert(entry.owner);
    } else {
      objectTypes.insert(entry.type);
    }
  }
  EXPECT_GE(nodes, 9u);
  EXPECT_EQ(witnesses, 1u);
  EXPECT_EQ(ipv4Only, 1u);
  EXPECT_GE(unhealthy, 2u);
  EXPECT_EQ(healthyNodes.size(), nodes - 1);
  EXPECT_GE(ipv4, 4u);
  EXPECT_GE(ipv6, 4u);
  EXPECT_EQ(objectTypes.size(), 2u);
}

/* ---- Differences ----------------------------------------------------------------------------- */

Entry entry(uint8_t type, const std::string &end, uint8_t data = 0) {
  return {type, uuid(end), uuid("a1"), {data}};
}

TEST(Difference, HoldsWhatIsNewOrOtherAndWhatIsGoneAndNothingElse) {
  const auto news = host::difference({entry(3, "a1"), entry(3, "a2", 1), entry(3, "a4")},
                                     {entry(3, "a1"), entry(3, "a2", 2), entry(3, "a3")});
  EXPECT_THAT(news.changed, ElementsAre(entry(3, "a2", 2), entry(3, "a3")));
  EXPECT_THAT(news.removed, ElementsAre(entry(3, "a4")));
  EXPECT_TRUE(host::difference({entry(3, "a1")}, {entry(3, "a1")}).empty());
}

TEST(Difference, BuildsFromTheGroundUpAndTakesDownFromTheTop) {
  const std::vector<Entry> cluster = {entry(0, "c1"), entry(3, "a1"), entry(6, "b1"),
                                      entry(7, "b1"), entry(9, "c2")};
  EXPECT_THAT(
      host::difference({}, cluster).changed,
      ElementsAre(entry(7, "b1"), entry(6, "b1"), entry(3, "a1"), entry(0, "c1"), entry(9, "c2")));
  EXPECT_THAT(
      host::difference(cluster, {}).removed,
      ElementsAre(entry(0, "c1"), entry(9, "c2"), entry(3, "a1"), entry(6, "b1"), entry(7, "b1")));
}

/* ---- Reloads --------------------------------------------------------------------------------- */

/* Calls from other threads, taken one by one. */
template <typename Call>
class Calls {
 public:
  void add(const Call &call) {
    const std::lock_guard lock(mutex_);
    calls_.push_back(call);
    arrived_.notify_all();
  }
  Call next() {
    std::unique_lock lock(mutex_);
    if (!arrived_.wait_for(lock, std::chrono::minutes(1), [&] { return !calls_.empty(); })) {
      throw std::runtime_error("nothing was reported");
    }
    Call call = calls_.front();
    calls_.pop_front();
    return call;
  }

 private:
  std::mutex mutex_;
  std::condition_variable arrived_;
  std::deque<Call> calls_;
};

/* A file in a folder of its own, its source and a directory with one subscriber to interfaces. */
class ClusterFileReload : public testing::Test {
 protected:
  void SetUp() override {
    host::setLogSink([](const host::LogLine &) {}, true);
    std::string folder = testing::TempDir() + "cluster.XXXXXX";
    ASSERT_NE(mkdtemp(folder.data()), nullptr);
    folder_ = folder;
    source.emplace(path(), directory);
  }
  void TearDown() override {
    source.reset();
    std::filesystem::remove_all(folder_);
    host::setLogSink({}, false);
  }

  std::string path(const std::string &name = "cluster.json") const { return folder_ / name; }
  void write(const std::string &text, const std::string &name = "cluster.json") const {
    std::ofstream(path(name)) << expand(text);
  }
  /* One node with two interfaces; the first one's health is up to the caller. */
  static std::string cluster(const char *healthy) {
    return std::string(R"({"nodes":[{"uuid":@a1,"interfaces":[{"uuid":@b1,"healthy":)") + healthy +
           R"(},{"uuid":@b2}]}]})";
  }
  uint32_t healthFlags(const std::string &end) const {
    KarstHealthStatusEntry record{};
    const auto held = directory.entry(KARST_TYPE_HEALTH_STATUS, uuid(end));
    EXPECT_TRUE(held && host::decode(held->data, &record) == ZEL_OK);
    return record.healthFlags;
  }

  host::Directory directory;
  std::optional<host::ClusterFileSource> source;
  Calls<host::Reload> reports;
  std::filesystem::path folder_;
};

TEST_F(ClusterFileReload, SubscribersHearOfTheDifferenceAlone) {
  struct Heard {
    std::mutex mutex;
    std::vector<std::string> calls;
  } heard;
  KarstQuery query{};
  query.type = KARST_TYPE_NET_INTERFACE;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL | KARST_QUERY_REPLICA;
  const KarstSubscriptionFn listen = [](void *data, const KarstEntryHeader *header, void *,
                                        zel_Status status) -> zel_Status {
    auto *to = static_cast<Heard *>(data);
    const std::lock_guard lock(to->mutex);
    const bool named = status == ZEL_OK || status == ZEL_NOT_FOUND;
    to->calls.push_back(std::string(status == ZEL_OK ? "+" : "-") +
                        (named ? host::toString(header->uuid).substr(34) : "end"));
    return ZEL_OK;
  };
  write(R"({"nodes":[{"uuid":@a1,"interfaces":[{"uuid":@b1},{"uuid":@b2},{"uuid":@b3}]}]})");
  source->load();
  ASSERT_EQ(directory.subscribe(&query, listen, &heard), ZEL_OK);
  directory.waitUntilIdle();
  heard.calls.clear();

  /* b1 stays, b2 changes, b3 goes, b4 comes */
  write(R"({"nodes":[{"uuid":@a1,"interfaces":[
            {"uuid":@b4},{"uuid":@b2,"addresses":["192.0.2.1"]},{"uuid":@b1}]}]})");
  source->load();
  directory.waitUntilIdle();
  EXPECT_THAT(heard.calls, ElementsAre("-b3", "+b2", "+b4"));
  directory.unsubscribe(&query, listen, &heard);
  directory.waitUntilIdle();
}

TEST_F(ClusterFileReload, OnlyWhatTheFileSaidBeforeIsTakenAway) {
  write(cluster("true"));
  source->load();
  directory.put({9, uuid("c9"), uuid("a1"), {}});
  write(R"({"nodes":[]})");
  source->load();
  EXPECT_THAT(directory.entries(KARST_TYPE_NODE), IsEmpty());
  EXPECT_THAT(directory.entries(KARST_TYPE_NET_INTERFACE), IsEmpty());
  EXPECT_THAT(directory.entries(KARST_TYPE_HEALTH_STATUS), IsEmpty());
  EXPECT_EQ(directory.entries(9).size(), 1u);
}

TEST_F(ClusterFileReload, ARefusedFileLeavesTheAnswerAlone) {
  write(cluster("true"));
  source->load();
  write(cluster("false") + "}");
  EXPECT_THROW(source->load(), host::ClusterFileError);
  EXPECT_THAT(source->reload().refusal, HasSubstr("cluster.json:1:"));
  EXPECT_EQ(healthFlags("b1"), 0u);
  EXPECT_EQ(source->content().entries.size(), 5u);

  write(cluster("false"));
  const auto result = source->reload();
  EXPECT_EQ(result.refusal, "");
  ASSERT_EQ(result.difference.changed.size(), 1u);
  EXPECT_EQ(result.difference.changed[0].type, KARST_TYPE_HEALTH_STATUS);
  EXPECT_EQ(healthFlags("b1"), 1u);
}

TEST_F(ClusterFileReload, AWatchedFileIsReadWhenWrittenOrRenamedOver) {
  write(cluster("true"));
  source->load();
  source->watch([&](const host::Reload &result) { reports.add(result); });

  write(cluster("false"));
  EXPECT_EQ(reports.next().difference.changed.size(), 1u);
  EXPECT_EQ(healthFlags("b1"), 1u);

  write(cluster("true"), "cluster.json.new");
  std::filesystem::rename(path("cluster.json.new"), path());
  EXPECT_EQ(reports.next().difference.changed.size(), 1u);
  EXPECT_EQ(healthFlags("b1"), 0u);

  /* and once more: the watch did not go with the file that was replaced */
  write(cluster("false"));
  EXPECT_EQ(reports.next().difference.changed.size(), 1u);
  EXPECT_EQ(healthFlags("b1"), 1u);
}

TEST_F(ClusterFileReload, WhatHappenedBetweenLoadAndWatchIsNoticed) {
  write(cluster("true"));
  source->load();
  write(cluster("false"));
  source->watch([&](const host::Reload &result) { reports.add(result); });
  EXPECT_EQ(reports.next().difference.changed.size(), 1u);
  EXPECT_EQ(healthFlags("b1"), 1u);
}

TEST_F(ClusterFileReload, WatchedRefusalsAndTheirEndAreReported) {
  write(cluster("true"));
  source->load();
  source->watch([&](const host::Reload &result) { reports.add(result); });
  write("{");
  EXPECT_THAT(reports.next().refusal, HasSubstr("cluster.json:1:2: no valid JSON"));
  write(cluster("true")); /* as before the refusal: good again is news even so */
  const auto recovered = reports.next();
  EXPECT_EQ(recovered.refusal, "");
  EXPECT_TRUE(recovered.difference.empty());
}

TEST_F(ClusterFileReload, AFileThatIsGoneIsReportedOnceAndReadWhenItIsBack) {
  write(cluster("true"));
  source->load();
  source->watch([&](const host::Reload &result) { reports.add(result); });
  std::filesystem::rename(path(), path("aside"));
  EXPECT_THAT(reports.next().refusal, HasSubstr("the file is gone"));
  EXPECT_EQ(directory.entries(KARST_TYPE_NET_INTERFACE).size(), 2u);

  write(cluster("false"), "aside");
  std::filesystem::rename(path("aside"), path());
  EXPECT_EQ(reports.next().difference.changed.size(), 1u);
  EXPECT_EQ(healthFlags("b1"), 1u);
}

TEST_F(ClusterFileReload, AFolderThatCannotBeWatchedIsAnError) {
  host::ClusterFileSource elsewhere("/nonexistent/cluster.json", directory);
  EXPECT_THROW(elsewhere.watch([](const host::Reload &) {}), std::system_error);
}

/* ---- UUIDs that are not stored --------------------------------------------------------------- */

class MachineUUID : public testing::Test {
 protected:
  std::string file(const std::string &text) const {
    const std::string path = testing::TempDir() + "machine-id." + std::to_string(getpid());
    std::ofstream(path) << text;
    return path;
  }
  static std::string complaint(const std::string &path) {
    try {
      return "none: " + host::toString(host::machineUUID(path));
    } catch (const std::runtime_error &error) {
      return error.what();
    }
  }
};

TEST_F(MachineUUID, IsTheMachineId) {
  EXPECT_EQ(host::toString(host::machineUUID(file("00112233445566778899aabbccddeeff\n"))),
            "00112233-4455-6677-8899-aabbccddeeff");
}

TEST_F(MachineUUID, MissingOrUnusableSaysWhatToDoInstead) {
  EXPECT_THAT(complaint("/nonexistent/machine-id"), HasSubstr("give it with --self"));
  EXPECT_THAT(complaint(file("uninitialized\n")), HasSubstr("\"uninitialized\" is no machine id"));
  EXPECT_THAT(complaint(file("00000000000000000000000000000000\n")), HasSubstr("no machine id"));
  EXPECT_THAT(complaint(file("")), HasSubstr("cannot be read"));
}

TEST(NamedUUID, FollowsFromOwnerAndNameAlone) {
  /* The standard's own example: the DNS name space and a host name. */
  const zel_UUID dns = host::parseUUID("6ba7b810-9dad-11d1-80b4-00c04fd430c8").value();
  EXPECT_EQ(host::toString(host::namedUUID(dns, "www.example.com")),
            "2ed6657d-e927-568b-95e1-2665a8aea6a2");
  EXPECT_NE(host::namedUUID(dns, "eth0"), host::namedUUID(dns, "eth1"));
  EXPECT_NE(host::namedUUID(dns, "eth0"), host::namedUUID(uuid("a1"), "eth0"));
}

/* ---- This machine's interfaces --------------------------------------------------------------- */

host::OwnAddress own(const std::string &text, bool local = false, bool passing = false) {
  host::OwnAddress result;
  result.address.isIPv6 = text.find(':') != std::string::npos;
  EXPECT_EQ(
      inet_pton(result.address.isIPv6 ? AF_INET6 : AF_INET, text.c_str(), result.address.address),
      1);
  result.local = local;
  result.passing = passing;
  return result;
}

std::vector<std::string> published(const host::OwnInterface &interface) {
  std::vector<std::string> texts;
  for (const auto &address : host::publishedAddresses(interface)) {
    texts.push_back(addressText(address));
  }
  return texts;
}

TEST(OwnInterfaces, AddressesComeInAnOrderThatDoesNotDependOnTheSystem) {
  host::OwnInterface eth0;
  eth0.addresses = {own("2001:db8::9", false, true),
                    own("2001:db8::1"),
                    own("fe80::1", true),
                    own("192.0.2.9"),
                    own("192.0.2.4"),
                    own("192.0.2.1", false, true)};
  const std::vector<std::string> expected = {"192.0.2.4", "192.0.2.9", "2001:db8::1", "192.0.2.1",
                                             "2001:db8::9"};
  EXPECT_EQ(published(eth0), expected);
  std::reverse(eth0.addresses.begin(), eth0.addresses.end());
  EXPECT_EQ(published(eth0), expected);
}

TEST(OwnInterfaces, AnEighthAddressIsLeftOutAndTheLogSaysSo) {
  std::vector<std::string> lines;
  host::setLogSink([&](const host::LogLine &line) { lines.push_back(line.text); }, true);
  host::OwnInterface eth0;
  eth0.name = "eth0";
  for (const char *end : {"8", "7", "6", "5", "4", "3", "2"}) {
    eth0.addresses.push_back(own(std::string("192.0.2.") + end));
  }
  EXPECT_EQ(published(eth0).size(), 7u);
  EXPECT_THAT(lines, IsEmpty());
  eth0.addresses.push_back(own("192.0.2.1"));
  EXPECT_THAT(published(eth0), ElementsAre("192.0.2.1", "192.0.2.2", "192.0.2.3", "192.0.2.4",
                                           "192.0.2.5", "192.0.2.6", "192.0.2.7"));
  host::setLogSink({}, false);
  EXPECT_THAT(lines, ElementsAre("interface eth0 has 8 addresses: the first 7 are published"));
}

TEST(OwnInterfaces, ANodeIsPublishedWithItsInterfacesAndTheirCarriersAsHealth) {
  host::OwnInterface lo{"lo", {}, true, true, {own("127.0.0.1", true)}};
  host::OwnInterface up{"eth0", {2, 0, 0, 0, 0, 1}, false, true, {own("192.0.2.1")}};
  host::OwnInterface down{"eth1", {2, 0, 0, 0, 0, 2}, false, false, {own("2001:db8::1")}};
  host::OwnInterface bare{"eth2", {2, 0, 0, 0, 0, 3}, false, true, {own("fe80::1", true)}};
  host::OwnNode node;
  node.uuid = uuid("a1");
  node.majorVersion = 3;
  node.witness = true;
  const auto entries = host::entriesOf(node, {lo, up, down, bare});
  ASSERT_EQ(entries.size(), 5u); /* the node, two interfaces, two healths */
  EXPECT_TRUE(std::is_sorted(entries.begin(), entries.end(), host::comesBefore));
  const auto nodeRecord = decoded<KarstNodeEntry>(entries, KARST_TYPE_NODE, "a1");
  EXPECT_EQ(nodeRecord.majorVersionNum, 3u);
  EXPECT_EQ(nodeRecord.flags, KARST_NODE_FLAG_WITNESS);

  const auto held = [&](const std::string &name, uint8_t type) {
    const auto found = std::find_if(entries.begin(), entries.end(), [&](const Entry &e) {
      return e.type == type && e.uuid == host::namedUUID(node.uuid, name);
    });
    EXPECT_NE(found, entries.end());
    EXPECT_EQ(found->owner, node.uuid);
    return *found;
  };
  KarstNetInterfaceEntry record{};
  ASSERT_EQ(host::decode(held("eth0", KARST_TYPE_NET_INTERFACE).data, &record), ZEL_OK);
  EXPECT_EQ(record.networkType, KARST_NETWORK_TYPE_IP);
  EXPECT_THAT(record.macAddress, ElementsAre(2, 0, 0, 0, 0, 1));
  EXPECT_THAT(addressTexts(record), ElementsAre("192.0.2.1"));
  EXPECT_EQ(record.trafficTypeMask, 0u);
  KarstHealthStatusEntry health{};
  ASSERT_EQ(host::decode(held("eth0", KARST_TYPE_HEALTH_STATUS).data, &health), ZEL_OK);
  EXPECT_EQ(health.healthFlags, 0u);
  ASSERT_EQ(host::decode(held("eth1", KARST_TYPE_HEALTH_STATUS).data, &health), ZEL_OK);
  EXPECT_NE(health.healthFlags, 0u);

  node.includeLoopback = true;
  EXPECT_EQ(host::entriesOf(node, {lo, up, down, bare}).size(), 7u);
}

/* Every machine has a loopback interface; another way to ask the system says what is to be found.
 */
TEST(OwnInterfaces, WhatTheSystemSaysReachesTheDirectory) {
  ifaddrs *all = nullptr;
  ASSERT_EQ(getifaddrs(&all), 0);
  std::set<std::string> loopbackAddresses;
  std::string loopback;
  bool running = false;
  for (const ifaddrs *i = all; i != nullptr; i = i->ifa_next) {
    if (!(i->ifa_flags & IFF_LOOPBACK)) continue;
    loopback = i->ifa_name;
    running = i->ifa_flags & IFF_RUNNING;
    char text[INET6_ADDRSTRLEN];
    if (i->ifa_addr != nullptr && i->ifa_addr->sa_family == AF_INET) {
      const auto *ipv4 = reinterpret_cast<const sockaddr_in *>(i->ifa_addr);
      loopbackAddresses.insert(inet_ntop(AF_INET, &ipv4->sin_addr, text, sizeof text));
    } else if (i->ifa_addr != nullptr && i->ifa_addr->sa_family == AF_INET6) {
      const auto *ipv6 = reinterpret_cast<const sockaddr_in6 *>(i->ifa_addr);
      loopbackAddresses.insert(inet_ntop(AF_INET6, &ipv6->sin6_addr, text, sizeof text));
    }
  }
  freeifaddrs(all);
  ASSERT_NE(loopback, "");

  host::Directory directory;
  host::OwnNode node;
  node.uuid = uuid("a1");
  node.includeLoopback = true;
  host::OwnInterfacesSource source(node, directory);
  EXPECT_FALSE(source.load().empty());
  EXPECT_TRUE(directory.entry(KARST_TYPE_NODE, node.uuid).has_value());

  const zel_UUID interface = host::namedUUID(node.uuid, loopback);
  KarstNetInterfaceEntry record{};
  const auto held = directory.entry(KARST_TYPE_NET_INTERFACE, interface);
  ASSERT_TRUE(held.has_value());
  ASSERT_EQ(host::decode(held->data, &record), ZEL_OK);
  EXPECT_THAT(addressTexts(record), testing::UnorderedElementsAreArray(loopbackAddresses));
  KarstHealthStatusEntry health{};
  ASSERT_EQ(host::decode(directory.entry(KARST_TYPE_HEALTH_STATUS, interface)->data, &health),
            ZEL_OK);
  EXPECT_EQ(health.healthFlags == 0, running);
  EXPECT_TRUE(source.load().empty()); /* nothing new since */
}

}  // namespace
