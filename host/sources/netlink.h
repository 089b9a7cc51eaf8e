/* What the operating system says about this machine's interfaces, through netlink. No lock: an
 * object is used by one thread at a time.
 */
#pragma once

#include <memory>
#include <vector>

#include "host/sources/own_interfaces.h"

struct nl_sock;

namespace host {

class Netlink {
 public:
  Netlink(); /* throws std::runtime_error where the system has no route netlink */
  ~Netlink();
  Netlink(const Netlink &) = delete;
  Netlink &operator=(const Netlink &) = delete;

  /* All interfaces with their addresses, as they are now. Throws std::runtime_error. */
  std::vector<OwnInterface> interfaces();

  /* Readable when an interface or an address has changed since the object was made or changes were
   * last taken. */
  int changeDescriptor() const;

  /* Forgets the changes that are due; interfaces() then shows at least what they said. */
  void takeChanges();

 private:
  struct Close {
    void operator()(nl_sock *socket) const;
  };
  std::unique_ptr<nl_sock, Close> changes_; /* member of the multicast groups */
  std::unique_ptr<nl_sock, Close> reading_; /* asks and receives answers */
};

}  // namespace host
