/* Links and addresses through libnl-route. Change messages are taken as "something changed", never
 * for what they say: everything is read afresh, so that messages that the system had to drop cost
 * nothing. No lock.
 */
#include "host/sources/netlink.h"

#include <linux/if_addr.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netlink/netlink.h>
#include <netlink/route/addr.h>
#include <netlink/route/link.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <map>
#include <optional>
#include <stdexcept>
#include <string>

namespace host {
namespace {

constexpr unsigned carrierFlag = 1u << 16; /* IFF_LOWER_UP, which net/if.h does not have */

void check(int result, const char *what) {
  if (result < 0) throw std::runtime_error(std::string(what) + ": " + nl_geterror(result));
}

struct FreeCache {
  void operator()(nl_cache *cache) const { nl_cache_free(cache); }
};
using Cache = std::unique_ptr<nl_cache, FreeCache>;

OwnInterface interfaceOf(rtnl_link *link) {
  OwnInterface interface;
  interface.name = rtnl_link_get_name(link);
  const unsigned flags = rtnl_link_get_flags(link);
  interface.loopback = flags & IFF_LOOPBACK;
  interface.carrier = flags & carrierFlag;
  const nl_addr *mac = rtnl_link_get_addr(link);
  if (mac != nullptr && nl_addr_get_len(mac) == interface.mac.size()) {
    std::memcpy(interface.mac.data(), nl_addr_get_binary_addr(mac), interface.mac.size());
  }
  return interface;
}

/* Nothing for an address that cannot be used: of another family, or not (yet) known to be unique.
 */
std::optional<OwnAddress> addressOf(rtnl_addr *address) {
  const nl_addr *bytes = rtnl_addr_get_local(address);
  const int family = rtnl_addr_get_family(address);
  const unsigned flags = rtnl_addr_get_flags(address);
  if (bytes == nullptr || (family != AF_INET && family != AF_INET6)) return std::nullopt;
  if (flags & (IFA_F_TENTATIVE | IFA_F_DADFAILED)) return std::nullopt;

  OwnAddress own;
  own.address.isIPv6 = family == AF_INET6;
  std::memcpy(own.address.address, nl_addr_get_binary_addr(bytes),
              std::min<size_t>(nl_addr_get_len(bytes), sizeof own.address.address));
  own.local = rtnl_addr_get_scope(address) >= RT_SCOPE_LINK;
  own.passing = flags & (IFA_F_SECONDARY | IFA_F_DEPRECATED); /* of IPv6, secondary is temporary */
  return own;
}

}  // namespace

void Netlink::Close::operator()(nl_sock *socket) const {
  nl_socket_free(socket);
}

Netlink::Netlink() : changes_(nl_socket_alloc()), reading_(nl_socket_alloc()) {
  if (!changes_ || !reading_) throw std::bad_alloc();
  check(nl_connect(reading_.get(), NETLINK_ROUTE), "netlink");
  check(nl_connect(changes_.get(), NETLINK_ROUTE), "netlink");
  check(nl_socket_add_memberships(changes_.get(), RTNLGRP_LINK, RTNLGRP_IPV4_IFADDR,
                                  RTNLGRP_IPV6_IFADDR, 0),
        "netlink groups");
}

Netlink::~Netlink() = default;

std::vector<OwnInterface> Netlink::interfaces() {
  nl_cache *cache = nullptr;
  check(rtnl_link_alloc_cache(reading_.get(), AF_UNSPEC, &cache), "reading links");
  const Cache links(cache);
  check(rtnl_addr_alloc_cache(reading_.get(), &cache), "reading addresses");
  const Cache addresses(cache);

  std::map<int, OwnInterface> byIndex;
  for (nl_object *o = nl_cache_get_first(links.get()); o != nullptr; o = nl_cache_get_next(o)) {
    auto *link = reinterpret_cast<rtnl_link *>(o);
    byIndex[rtnl_link_get_ifindex(link)] = interfaceOf(link);
  }
  for (nl_object *o = nl_cache_get_first(addresses.get()); o != nullptr; o = nl_cache_get_next(o)) {
    auto *address = reinterpret_cast<rtnl_addr *>(o);
    const auto interface = byIndex.find(rtnl_addr_get_ifindex(address));
    const auto own = addressOf(address);
    if (interface != byIndex.end() && own) interface->second.addresses.push_back(*own);
  }
  std::vector<OwnInterface> result;
  result.reserve(byIndex.size());
  for (auto &[index, interface] : byIndex) result.push_back(std::move(interface));
  return result;
}

int Netlink::changeDescriptor() const {
  return nl_socket_get_fd(changes_.get());
}

void Netlink::takeChanges() {
  char unused[64];
  /* ENOBUFS says that messages were dropped, once; those that are still due follow it. */
  while (recv(changeDescriptor(), unused, sizeof unused, MSG_DONTWAIT) >= 0 || errno == EINTR ||
         errno == ENOBUFS) {
  }
}

}  // namespace host
