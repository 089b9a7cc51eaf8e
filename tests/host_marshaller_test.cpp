/* The marshaller's promises: the bytes on the wire, round trips, and what is refused with which
 * status. Everything is done in one thread.
 */
#include "host/directory/marshaller.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "host/directory/records.h"
#include "host/kernel/log.h"

namespace {

using Bytes = std::vector<uint8_t>;

/* Bytes of a test vector: text in double quotes stands for its characters with a CBOR head, the
 * rest is hexadecimal. */
Bytes wire(const std::string &text) {
  Bytes bytes;
  for (size_t i = 0; i < text.size();) {
    if (text[i] == ' ') {
      ++i;
    } else if (text[i] == '"') {
      const size_t end = text.find('"', i + 1);
      const std::string name = text.substr(i + 1, end - i - 1);
      if (name.size() < 24) {
        bytes.push_back(static_cast<uint8_t>(0x60 + name.size()));
      } else {
        bytes.push_back(0x78);
        bytes.push_back(static_cast<uint8_t>(name.size()));
      }
      bytes.insert(bytes.end(), name.begin(), name.end());
      i = end + 1;
    } else {
      bytes.push_back(static_cast<uint8_t>(std::stoul(text.substr(i, 2), nullptr, 16)));
      i += 2;
    }
  }
  return bytes;
}

bool same(const auto &a, const auto &b) {
  return std::memcmp(&a, &b, sizeof a) == 0;
}

KarstNetInterfaceEntry interfaceRecord() {
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  const uint8_t ipv4[] = {192, 0, 2, 1};
  std::memcpy(record.ipv4Address, ipv4, sizeof ipv4);
  record.agentGroupPort = 23451;
  record.masterGroupPort = 12345;
  record.multicastTTL = 5;
  record.bandwidth = 10'000'000'000;
  const uint8_t mac[] = {2, 0, 0, 0, 0, 1};
  std::memcpy(record.macAddress, mac, sizeof mac);
  record.agentV6Group[0] = 0xff;
  record.masterV6Group[15] = 0x02;
  record.numIpAddresses = 2;
  std::memcpy(record.ipAddresses[0].address, ipv4, sizeof ipv4);
  record.ipAddresses[1].isIPv6 = 1;
  record.ipAddresses[1].address[0] = 0x20;
  record.ipAddresses[1].address[15] = 0x07;
  record.trafficTypeMask = UINT64_MAX;
  return record;
}

const std::string interfaceWire =
    "aa"
    "\"networkType\" a2 \"type\" 01 \"ipv4\" 44 c0000201"
    "\"agentGroupPort\" 19 5b9b"
    "\"masterGroupPort\" 19 3039"
    "\"multicastTTL\" 05"
    "\"bandwidth\" 1b 00000002540be400"
    "\"macAddress\" 46 020000000001"
    "\"agentV6Group\" 50 ff000000000000000000000000000000"
    "\"masterV6Group\" 50 00000000000000000000000000000002"
    "\"numIpAddresses\" 82 44 c0000201 50 20000000000000000000000000000007"
    "\"trafficTypeMask\" 1b ffffffffffffffff";

/* ---- The wire -------------------------------------------------------------------------------- */

TEST(MarshallerWire, NodeRecord) {
  const KarstNodeEntry record{6, 24, KARST_NODE_FLAG_WITNESS, 256, 65536};
  const Bytes bytes = wire(
      "a5 \"majorVersionNum\" 06 \"minorVersionNum\" 18 18 \"flags\" 02"
      "\"requiredTolmMajorVersion\" 19 0100 \"requiredTolmMinorVersion\" 1a 00010000");
  EXPECT_EQ(host::encode(record), bytes);
  KarstNodeEntry decoded;
  ASSERT_EQ(host::decode(bytes, &decoded), ZEL_OK);
  EXPECT_TRUE(same(decoded, record));
}

TEST(MarshallerWire, InterfaceRecord) {
  const KarstNetInterfaceEntry record = interfaceRecord();
  EXPECT_EQ(host::encode(record), wire(interfaceWire));
  KarstNetInterfaceEntry decoded;
  ASSERT_EQ(host::decode(wire(interfaceWire), &decoded), ZEL_OK);
  EXPECT_TRUE(same(decoded, record));
}

TEST(MarshallerWire, HealthRecord) {
  const KarstHealthStatusEntry record{1, 0, 0x1'0000'0000, UINT32_MAX, 0};
  const Bytes bytes =
      wire("a3 \"healthFlags\" 01 \"timestamp\" 1b 0000000100000000 \"healthReason\" 1a ffffffff");
  EXPECT_EQ(host::encode(record), bytes);
  KarstHealthStatusEntry decoded;
  ASSERT_EQ(host::decode(bytes, &decoded), ZEL_OK);
  EXPECT_TRUE(same(decoded, record));
}

TEST(MarshallerWire, AnotherNetworkTypeCarriesNoIpv4Address) {
  KarstNetInterfaceEntry record = interfaceRecord();
  record.networkType = 9;
  const Bytes bytes = host::encode(record);
  EXPECT_THAT(Bytes(bytes.begin() + 1, bytes.begin() + 20),
              testing::ElementsAreArray(wire("\"networkType\" a1 \"type\" 09")));
  /* Not even one that a writer put there, before the type or behind it. */
  for (const char *part :
       {"a2 \"type\" 09 \"ipv4\" 44 c0000201", "a2 \"ipv4\" 44 c0000201 \"type\" 09"}) {
    KarstNetInterfaceEntry decoded;
    ASSERT_EQ(host::decode(wire(std::string("a1 \"networkType\"") + part), &decoded), ZEL_OK);
    KarstNetInterfaceEntry expected{};
    expected.networkType = 9;
    EXPECT_TRUE(same(decoded, expected)) << part;
  }
}

TEST(MarshallerWire, Ipv4AddressMayStandBeforeTheType) {
  KarstNetInterfaceEntry decoded;
  ASSERT_EQ(host::decode(wire("a1 \"networkType\" a2 \"ipv4\" 44 01020304 \"type\" 01"), &decoded),
            ZEL_OK);
  EXPECT_THAT(decoded.ipv4Address, testing::ElementsAre(1, 2, 3, 4));
}

/* ---- What readers accept --------------------------------------------------------------------- */

TEST(MarshallerReading, MissingFieldsStayAndTheOrderIsFree) {
  KarstNodeEntry record{1, 2, 3, 4, 5};
  const Bytes bytes = wire("a2 \"flags\" 07 \"majorVersionNum\" 08");
  ASSERT_EQ(host::unmarshal(host::nodeRecordTable, bytes.data(), bytes.size(), &record), ZEL_OK);
  EXPECT_TRUE(same(record, KarstNodeEntry{8, 2, 7, 4, 5}));
}

TEST(MarshallerReading, IndefiniteMapsArraysAndByteStrings) {
  KarstNetInterfaceEntry record;
  ASSERT_EQ(
      host::decode(wire("bf \"networkType\" bf \"type\" 01 \"ipv4\" 5f 42 0102 40 42 0304 ff ff"
                        "\"macAddress\" 5f 46 0a0b0c0d0e0f ff"
                        "\"numIpAddresses\" 9f 44 05060708 5f 44 09090909 ff ff ff"),
                   &record),
      ZEL_OK);
  EXPECT_THAT(record.ipv4Address, testing::ElementsAre(1, 2, 3, 4));
  EXPECT_THAT(record.macAddress, testing::ElementsAre(10, 11, 12, 13, 14, 15));
  ASSERT_EQ(record.numIpAddresses, 2u);
  EXPECT_EQ(record.ipAddresses[0].address[3], 8);
  EXPECT_EQ(record.ipAddresses[1].address[0], 9);
  EXPECT_EQ(record.ipAddresses[1].isIPv6, 0);
}

TEST(MarshallerReading, UnknownNamesArePassedOver) {
  const char *values[] = {
      "00",                            /* unsigned */
      "3b 0000000100000000",           /* negative */
      "58 02 ffff",                    /* bytes */
      "5f 41 00 42 0000 ff",           /* bytes in chunks */
      "7f \"a\" \"bc\" ff",            /* text in chunks */
      "83 01 82 02 03 80",             /* arrays */
      "9f 01 9f ff bf \"x\" 00 ff ff", /* indefinite */
      "a1 82 01 02 a0",                /* a map with an array for a name */
      "c1 1a 00000000",                /* tags: known, unassigned, two in a row */
      "c7 00",
      "d9 d9f7 c0 60",
      "f4", /* simple values and floats */
      "f6",
      "e0",
      "f8 ff",
      "f9 7c00",
      "fb 7ff0000000000000",
  };
  for (const char *value : values) {
    KarstNodeEntry record;
    const std::string pair = std::string("\"flag\"") + value;
    EXPECT_EQ(host::decode(wire("a3 \"majorVersionNum\" 01" + pair + "\"flags\" 02"), &record),
              ZEL_OK)
        << value;
    EXPECT_TRUE(same(record, KarstNodeEntry{1, 0, 2, 0, 0})) << value;
  }
}

TEST(MarshallerReading, NestingHasABound) {
  const auto nested = [](size_t arrays) {
    std::string text = "a1 \"x\"";
    for (size_t i = 0; i < arrays; ++i) text += "81";
    return wire(text + "00");
  };
  KarstNodeEntry record;
  EXPECT_EQ(host::decode(nested(15), &record), ZEL_OK);
  EXPECT_EQ(host::decode(nested(16), &record), EXPR_MSH_MALFORMED);
  EXPECT_EQ(host::decode(nested(100'000), &record), EXPR_MSH_MALFORMED);
  /* Siblings do not add up. */
  std::string siblings = "98 64";
  for (int i = 0; i < 100; ++i) siblings += "81 80";
  EXPECT_EQ(host::decode(wire("a1 \"x\"" + siblings), &record), ZEL_OK);
}

/* ---- What is refused, and why ---------------------------------------------------------------- */

struct Refusal {
  const char *bytes;
  zel_Status status;
};

TEST(MarshallerRefusal, OfInterfaceRecords) {
  const Refusal refusals[] = {
      /* not a map of names */
      {"", EXPR_MSH_TRUNCATED},
      {"00", EXPR_MSH_MALFORMED},
      {"80", EXPR_MSH_MALFORMED},
      {"c1 a0", EXPR_MSH_MALFORMED},
      {"ff", EXPR_MSH_MALFORMED},
      {"a1 01 02", EXPR_MSH_MALFORMED},
      {"a1 7f \"bandwidth\" ff 02", EXPR_MSH_MALFORMED},
      /* not CBOR */
      {"1c", EXPR_MSH_MALFORMED},
      {"a1 \"x\" 1f", EXPR_MSH_MALFORMED},
      {"a1 \"x\" ff", EXPR_MSH_MALFORMED},
      {"bf \"x\" ff", EXPR_MSH_MALFORMED},
      {"a1 \"bandwidth\" ff", EXPR_MSH_MALFORMED},
      {"a1 \"x\" c1 ff", EXPR_MSH_MALFORMED},
      {"a1 \"x\" f8 1f", EXPR_MSH_MALFORMED},
      {"a1 \"x\" 5f \"text\" ff", EXPR_MSH_MALFORMED},
      {"a1 \"macAddress\" 5f 5f 40 ff ff", EXPR_MSH_MALFORMED},
      /* a field twice */
      {"a2 \"bandwidth\" 01 \"bandwidth\" 01", EXPR_MSH_MALFORMED},
      {"a1 \"networkType\" a2 \"type\" 01 \"type\" 01", EXPR_MSH_MALFORMED},
      {"a1 \"networkType\" a2 \"ipv4\" 44 00000001 \"ipv4\" 44 00000001", EXPR_MSH_MALFORMED},
      /* another type */
      {"a1 \"bandwidth\" 20", EXPR_MSH_BAD_TYPE},
      {"a1 \"bandwidth\" fa 3f800000", EXPR_MSH_BAD_TYPE},
      {"a1 \"bandwidth\" c1 01", EXPR_MSH_BAD_TYPE},
      {"a1 \"multicastTTL\" 41 01", EXPR_MSH_BAD_TYPE},
      {"a1 \"macAddress\" \"sixsix\"", EXPR_MSH_BAD_TYPE},
      {"a1 \"networkType\" 01", EXPR_MSH_BAD_TYPE},
      {"a1 \"networkType\" a1 \"type\" 40", EXPR_MSH_BAD_TYPE},
      {"a1 \"numIpAddresses\" 00", EXPR_MSH_BAD_TYPE},
      {"a1 \"numIpAddresses\" 81 00", EXPR_MSH_BAD_TYPE},
      /* out of range */
      {"a1 \"multicastTTL\" 1b 0000000100000000", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"networkType\" a1 \"type\" 1b 0000000100000001", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"networkType\" a1 \"ipv4\" 43 010203", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"networkType\" a1 \"ipv4\" 45 0102030405", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"macAddress\" 45 0102030405", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"macAddress\" 47 01020304050607", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"macAddress\" 5f 44 01020304 43 050607 ff", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"agentV6Group\" 44 01020304", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"numIpAddresses\" 81 45 0102030405", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"numIpAddresses\" 81 40", EXPR_MSH_OUT_OF_RANGE},
      {"a1 \"numIpAddresses\" 88 44 01010101 44 01010101 44 01010101 44 01010101 44 01010101"
       "44 01010101 44 01010101 44 01010101",
       EXPR_MSH_OUT_OF_RANGE},
      /* too short, too long */
      {"a1", EXPR_MSH_TRUNCATED},
      {"bf", EXPR_MSH_TRUNCATED},
      {"bb ffffffffffffffff \"x\" 00", EXPR_MSH_TRUNCATED},
      {"a1 \"macAddress\" 5b ffffffffffffffff 00", EXPR_MSH_TRUNCATED},
      {"a1 \"x\" 9b ffffffffffffffff 00", EXPR_MSH_TRUNCATED},
      {"a1 \"x\" f8", EXPR_MSH_TRUNCATED},
      {"a0 00", EXPR_MSH_TRAILING},
      {"a0 a0", EXPR_MSH_TRAILING},
      {"bf ff ff", EXPR_MSH_TRAILING},
  };
  for (const Refusal &refusal : refusals) {
    KarstNetInterfaceEntry record;
    EXPECT_EQ(host::decode(wire(refusal.bytes), &record), refusal.status) << refusal.bytes;
  }
}

TEST(MarshallerRefusal, SevenAddressesAreTheMostEitherWay) {
  KarstNetInterfaceEntry record = interfaceRecord();
  record.numIpAddresses = 7;
  const Bytes bytes = host::encode(record);
  KarstNetInterfaceEntry decoded;
  ASSERT_EQ(host::decode(bytes, &decoded), ZEL_OK);
  EXPECT_EQ(decoded.numIpAddresses, 7u);
  record.numIpAddresses = 8;
  Bytes out = {1, 2, 3};
  EXPECT_EQ(host::marshal(host::netInterfaceRecordTable, &record, &out), EXPR_MSH_OUT_OF_RANGE);
  EXPECT_EQ(out, (Bytes{1, 2, 3}));
}

TEST(MarshallerRefusal, TablesThatAreNone) {
  const ExprMshField unknownType[] = {{99, 0, 0, "x", nullptr, nullptr, {0, 0}}, {}};
  const ExprMshField noPair[] = {{EXPR_MSH_NESTED, 0, 0, "x", nullptr, nullptr, {0, 0}}, {}};
  uint64_t record = 0;
  const Bytes empty = {0xa0};
  for (const ExprMshField *table : {unknownType, noPair}) {
    Bytes out;
    EXPECT_EQ(host::marshal(table, &record, &out), ZEL_BAD_PARAM);
    EXPECT_EQ(host::unmarshal(table, empty.data(), empty.size(), &record), ZEL_BAD_PARAM);
  }
}

TEST(MarshallerRefusal, IsReportedWithTheRecordsName) {
  std::vector<std::string> lines;
  host::setLogSink([&](const host::LogLine &line) { lines.push_back(line.text); }, true);
  KarstNodeEntry record{};
  const Bytes good = wire("a1 \"flags\" 01"), bad = wire("a1 \"flags\" 40");
  EXPECT_EQ(ExprMsh_UmshSingleStructure(nullptr, host::nodeRecordTable, good.data(), good.size(),
                                        "KarstNodeEntry", &record),
            ZEL_OK);
  EXPECT_THAT(lines, testing::IsEmpty());
  EXPECT_EQ(ExprMsh_UmshSingleStructure(nullptr, host::nodeRecordTable, bad.data(), bad.size(),
                                        "KarstNodeEntry", &record),
            EXPR_MSH_BAD_TYPE);
  host::setLogSink({}, false);
  EXPECT_EQ(record.flags, 1u);
  EXPECT_THAT(lines, testing::ElementsAre(testing::HasSubstr("KarstNodeEntry")));
}

/* ---- Any record, any damage ------------------------------------------------------------------ */

class MarshallerProperties : public testing::Test {
 protected:
  /* Numbers of every magnitude, so that each length of a CBOR head occurs. */
  uint64_t number(unsigned bits) { return random_() >> (64 - bits + random_() % bits); }
  uint32_t number32() { return static_cast<uint32_t>(number(32)); }
  void fill(uint8_t *bytes, size_t length) {
    for (size_t i = 0; i < length; ++i) bytes[i] = static_cast<uint8_t>(random_());
  }

  KarstNodeEntry node() { return {number32(), number32(), number32(), number32(), number32()}; }
  KarstHealthStatusEntry health() { return {number32(), 0, number(64), number32(), 0}; }
  KarstNetInterfaceEntry netInterface() {
    KarstNetInterfaceEntry record{};
    record.networkType = random_() % 3 == 0 ? number32() : KARST_NETWORK_TYPE_IP;
    if (record.networkType == KARST_NETWORK_TYPE_IP) fill(record.ipv4Address, 4);
    record.agentGroupPort = number32();
    record.masterGroupPort = number32();
    record.multicastTTL = number32();
    record.bandwidth = number(64);
    fill(record.macAddress, sizeof record.macAddress);
    fill(record.agentV6Group, sizeof record.agentV6Group);
    fill(record.masterV6Group, sizeof record.masterV6Group);
    record.numIpAddresses = random_() % 8;
    for (uint32_t i = 0; i < record.numIpAddresses; ++i) {
      record.ipAddresses[i].isIPv6 = random_() % 2;
      fill(record.ipAddresses[i].address, record.ipAddresses[i].isIPv6 != 0 ? 16 : 4);
    }
    record.trafficTypeMask = number(64);
    return record;
  }

  std::mt19937_64 random_{20240717};
};

template <typename Record>
void expectRoundTrip(const Record &record) {
  Record decoded;
  ASSERT_EQ(host::decode(host::encode(record), &decoded), ZEL_OK);
  EXPECT_TRUE(same(decoded, record));
}

TEST_F(MarshallerProperties, RecordsComeBackAsTheyWere) {
  for (int i = 0; i < 2000; ++i) {
    expectRoundTrip(node());
    expectRoundTrip(netInterface());
    expectRoundTrip(health());
  }
}

template <typename Record>
void expectEveryCutRefused(const Record &record) {
  const Bytes bytes = host::encode(record);
  for (size_t length = 0; length < bytes.size(); ++length) {
    /* A copy of its own, so that a read past the end is found. */
    const Bytes cut(bytes.begin(), bytes.begin() + static_cast<ptrdiff_t>(length));
    Record decoded;
    ASSERT_EQ(host::decode(cut, &decoded), EXPR_MSH_TRUNCATED) << "cut to " << length;
  }
}

TEST_F(MarshallerProperties, EveryCutIsRefusedAsTruncated) {
  for (int i = 0; i < 50; ++i) {
    expectEveryCutRefused(node());
    expectEveryCutRefused(netInterface());
    expectEveryCutRefused(health());
  }
}

bool isVerdict(zel_Status status) {
  return status == ZEL_OK || (status >= EXPR_MSH_TRUNCATED && status <= EXPR_MSH_MALFORMED);
}

/* Every value of every byte: decoded or refused, within the bytes given and the record. */
template <typename Record>
void damageEveryByte(const Record &record, std::map<zel_Status, int> *seen) {
  const Bytes bytes = host::encode(record);
  for (size_t at = 0; at < bytes.size(); ++at) {
    for (unsigned flip = 1; flip < 256; ++flip) {
      Bytes damaged = bytes;
      damaged[at] = static_cast<uint8_t>(damaged[at] ^ flip);
      Record decoded;
      const zel_Status status = host::decode(damaged, &decoded);
      ASSERT_TRUE(isVerdict(status)) << std::hex << status << " at " << at << " flip " << flip;
      ++(*seen)[status];
    }
  }
}

TEST_F(MarshallerProperties, EveryDamagedByteIsDecodedOrRefused) {
  std::map<zel_Status, int> seen;
  damageEveryByte(node(), &seen);
  damageEveryByte(netInterface(), &seen);
  damageEveryByte(interfaceRecord(), &seen);
  damageEveryByte(health(), &seen);
  EXPECT_THAT(seen, testing::SizeIs(6)) << "each verdict is reached";
}

TEST_F(MarshallerProperties, NoiseIsDecodedOrRefused) {
  for (int i = 0; i < 50'000; ++i) {
    Bytes noise(random_() % 64);
    fill(noise.data(), noise.size());
    /* Noise alone hardly ever gets past its first bytes. */
    const Bytes head = i % 2 == 0 ? wire("bf \"x\"") : wire("bf \"numIpAddresses\" 9f");
    noise.insert(noise.begin(), head.begin(), head.end());
    KarstNetInterfaceEntry decoded;
    const zel_Status status = host::decode(noise, &decoded);
    ASSERT_TRUE(isVerdict(status)) << std::hex << status;
    ASSERT_LE(decoded.numIpAddresses, KARST_NET_INTERFACE_MAX_ADDRESSES);
  }
}

}  // namespace
