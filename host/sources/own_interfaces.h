/* This machine's network interfaces, and what they are as directory entries. Says nothing of where
 * they were read from. No lock: functions of their arguments.
 */
#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <vector>

#include "host/directory/directory.h"

namespace host {

struct OwnAddress {
  KarstIpAddress address{};
  bool local = false;   /* reaches no further than the machine or the link */
  bool passing = false; /* temporary, deprecated or secondary: preferred last */
  bool operator==(const OwnAddress &other) const;
};

struct OwnInterface {
  std::string name;
  std::array<uint8_t, 6> mac{};
  bool loopback = false;
  bool carrier = false; /* the link works */
  std::vector<OwnAddress> addresses;
  bool operator==(const OwnInterface &) const = default;
};

struct OwnNode {
  zel_UUID uuid{};
  uint32_t majorVersion = 0;
  uint32_t minorVersion = 0;
  bool witness = false;
  bool includeLoopback = false; /* otherwise loopback interfaces are left out */
};

/* The addresses that an interface is published with: at most 7, lasting ones first, among these
 * IPv4 before IPv6, among these in ascending order. Local ones are left out, except on a loopback
 * interface, which has no others. */
std::vector<KarstIpAddress> publishedAddresses(const OwnInterface &interface);

/* The entries of this machine's node, in the order of comesBefore: the node, and for each interface
 * with at least one address to publish the interface (its UUID follows from the node's UUID and its
 * name) and its health, which is good exactly while the carrier is there. */
std::vector<Entry> entriesOf(const OwnNode &node, const std::vector<OwnInterface> &interfaces);

}  // namespace host
