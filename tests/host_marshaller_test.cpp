/* The marshaller's promises: the bytes on the wire both ways, what readers accept, and what is
 * refused with which status. Everything is done in one thread.
 */
#include "host/directory/marshaller.h"

#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <regex>
#include <string>
#include <vector>

#include "host/directory/records.h"

namespace {

using Bytes = std::vector<uint8_t>;

/* Bytes of a test vector: text in single quotes stands for its characters with a CBOR head, the
 * rest is hexadecimal. */
Bytes wire(const std::string &text) {
  static const std::regex nameOrByte("'(.*?)'|[0-9a-f]{2}");
  Bytes bytes;
  for (std::sregex_iterator part(text.begin(), text.end(), nameOrByte), end; part != end; ++part) {
    const std::string name = part->str(1);
    if (name.empty()) {
      bytes.push_back(static_cast<uint8_t>(std::stoul(part->str(), nullptr, 16)));
      continue;
    }
    if (name.size() >= 24) bytes.push_back(0x78);
    bytes.push_back(static_cast<uint8_t>(name.size() + (name.size() < 24 ? 0x60 : 0)));
    bytes.insert(bytes.end(), name.begin(), name.end());
  }
  return bytes;
}

template <typename Record>
void expectDecoded(const std::string &text, const Record &expected) {
  Record decoded;
  EXPECT_EQ(host::decode(wire(text), &decoded), ZEL_OK) << text;
  EXPECT_EQ(std::memcmp(&decoded, &expected, sizeof decoded), 0) << text;
}

const std::string interfaceWire =
    "aa 'networkType' a2 'type' 01 'ipv4' 44 c0000000"
    "'agentGroupPort' 19 5b9b 'masterGroupPort' 19 3039 'multicastTTL' 05"
    "'bandwidth' 1b 00000002540be400 'macAddress' 46 000000000001"
    "'agentV6Group' 50 ff000000000000000000000000000000"
    "'masterV6Group' 50 00000200000000000000000000000000"
    "'numIpAddresses' 87 44 00000009 50 00000700000000000000000000000000"
    "44 00000000 44 00000000 44 00000000 44 00000000 44 00000000"
    "'trafficTypeMask' 1b ffffffffffffffff";

TEST(Marshaller, RecordsTravelAsMapsByFieldName) {
  const auto expectBothWays = [](const auto &record, const std::string &text) {
    EXPECT_EQ(host::encode(record), wire(text));
    expectDecoded(text, record);
  };
  expectBothWays(KarstNodeEntry{6, 24, KARST_NODE_FLAG_WITNESS, 256, 65536},
                 "a5 'majorVersionNum' 06 'minorVersionNum' 18 18 'flags' 02"
                 "'requiredTolmMajorVersion' 19 0100 'requiredTolmMinorVersion' 1a 00010000");
  expectBothWays(KarstHealthStatusEntry{1, 0, 0x1'0000'0000, UINT32_MAX, 0},
                 "a3 'healthFlags' 01 'timestamp' 1b 0000000100000000 'healthReason' 1a ffffffff");
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  record.ipv4Address[0] = 192;
  record.agentGroupPort = 23451;
  record.masterGroupPort = 12345;
  record.multicastTTL = 5;
  record.bandwidth = 10'000'000'000;
  record.macAddress[5] = 1;
  record.agentV6Group[0] = 0xff;
  record.masterV6Group[2] = 0x02;
  record.numIpAddresses = 7;
  record.ipAddresses[0].address[3] = 9;
  record.ipAddresses[1] = {1, {}, {0, 0, 7}};
  record.trafficTypeMask = UINT64_MAX;
  expectBothWays(record, interfaceWire);
  record.networkType = 9; /* which has no IPv4 address */
  EXPECT_EQ(host::encode(record), wire("aa 'networkType' a1 'type' 09" +
                                       interfaceWire.substr(interfaceWire.find("'agentGroupP"))));
}

/* Rows of two texts that must mean the same. */
TEST(Marshaller, TakesUnknownMissingAndIndefiniteThingsInAnyOrder) {
  const std::string ofType9 = "a1 'networkType' a1 'type' 09";
  const std::string rows[][2] = {
      {"a3 'multicastTTL' 02 'multicast' 9f 'TTL' ff 'agentGroupPort' 01",
       "a2 'agentGroupPort' 01 'multicastTTL' 02"},
      {"bf 'networkType' bf 'ipv4' 5f 42 0000 40 42 0004 ff 'type' 01 ff"
       "'macAddress' 5f 46 000000000001 ff 'numIpAddresses' 9f 44 00000000 5f 44 09000000 ff ff ff",
       "a3 'networkType' a2 'type' 01 'ipv4' 44 00000004 'macAddress' 46 000000000001"
       "'numIpAddresses' 82 44 00000000 44 09000000"},
      {"a1 'networkType' a2 7804 74797065 09 'ipv4' 44 c0000201", ofType9},
      {"a1 'networkType' a2 'ipv4' 44 c0000201 'type' 09", ofType9}};
  for (const auto &[text, plain] : rows) {
    KarstNetInterfaceEntry record;
    ASSERT_EQ(host::decode(wire(plain), &record), ZEL_OK) << plain;
    expectDecoded(text, record);
  }
}

const std::map<zel_Status, std::vector<std::string>> refusals = {
    {EXPR_MSH_MALFORMED,
     {"00", "a1 01 02", "bf 'x' ff", "a1 'bandwidth' ff", /* no map, no name, no value */
      "a1 'x' c1 ff", "a1 'x' f8 1f", "a1 'macAddress' 5f 5f 40 ff ff",
      "a1 4b 6e6574776f726b54797065 a0",            /* the bytes of a name, and no text */
      "a1 'x' 81818181818181818181818181818181 00", /* 17 deep */
      "a2 'bandwidth' 01 'bandwidth' 01", "a1 'networkType' a2 'type' 01 'type' 01"}},
    {EXPR_MSH_BAD_TYPE,
     {"a1 'bandwidth' 20", "a1 'bandwidth' c1 01", "a1 'macAddress' 'sixsix'",
      "a1 'networkType' 01", "a1 'networkType' a1 'type' 40", "a1 'numIpAddresses' 81 00"}},
    {EXPR_MSH_OUT_OF_RANGE,
     {"a1 'multicastTTL' 1b 0000000100000000", "a1 'networkType' a1 'ipv4' 43 010203",
      "a1 'macAddress' 5f 44 01020304 43 050607 ff", "a1 'numIpAddresses' 81 45 0102030405",
      "a1 'numIpAddresses' 88 44 01010101 44 01010101 44 01010101 44 01010101"
      "44 01010101 44 01010101 44 01010101 44 01010101"}},
    {EXPR_MSH_TRUNCATED, {"bb ffffffffffffffff 'x' 00", "a1 'x' 9b ffffffffffffffff 00"}},
    {EXPR_MSH_TRAILING, {"a0 00"}},
};

TEST(MarshallerRefusal, HasAStatusForEachFaultAndPassesOverUnknownValues) {
  for (const std::string value :
       {"3b 0000000100000000", "fb 7ff0000000000000", "5f 41 00 42 0000 ff", "7f 'a' 'bc' ff",
        "9f 01 9f ff bf 'x' 00 ff ff", "a1 82 01 02 a0", "d9 d9f7 c0 60",
        "818181818181818181818181818181 00"}) {
    expectDecoded("a1 'x'" + value, KarstNetInterfaceEntry{});
  }
  KarstNetInterfaceEntry record;
  for (const auto &[status, texts] : refusals) {
    for (const auto &text : texts) EXPECT_EQ(host::decode(wire(text), &record), status) << text;
  }
  const Bytes whole = wire(interfaceWire);
  for (auto end = whole.begin(); end != whole.end(); ++end) {
    const Bytes cut(whole.begin(), end); /* a copy of its own: a read past its end is found */
    EXPECT_EQ(host::decode(cut, &record), EXPR_MSH_TRUNCATED) << "cut to " << cut.size();
  }
}

TEST(MarshallerRefusal, OfTablesThatAreNoneAndOfEightAddresses) {
  KarstNetInterfaceEntry record{};
  record.numIpAddresses = 8;
  Bytes out = {0xa0};
  for (const uint64_t type : {uint64_t{99}, uint64_t{EXPR_MSH_NESTED}}) { /* without its pair */
    const ExprMshField table[] = {{type, 0, 0, "x", nullptr, nullptr, {0, 0}}, {}};
    EXPECT_EQ(host::unmarshal(table, out.data(), out.size(), &record), ZEL_BAD_PARAM);
    EXPECT_EQ(host::marshal(table, &record, &out), ZEL_BAD_PARAM);
  }
  EXPECT_EQ(host::marshal(host::netInterfaceRecordTable, &record, &out), EXPR_MSH_OUT_OF_RANGE);
  EXPECT_EQ(out, Bytes{0xa0}) << "nothing is left behind";
}

}  // namespace
