/* This machine's interfaces as they change. Runs in a network namespace of its own, where the only
 * interface is a loopback interface that is down, and where a test may do as it likes.
 */
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <linux/sockios.h>
#include <net/if.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <mutex>
#include <optional>

#include "host/directory/records.h"
#include "host/sources/machine_uuid.h"
#include "host/sources/own_interfaces_source.h"

namespace {

class LiveInterfaces : public testing::Test {
 protected:
  LiveInterfaces() {
    node_.uuid = host::parseUUID("00000000-0000-4000-8000-0000000000a1").value();
    node_.includeLoopback = true;
    source_.emplace(node_, directory_);
  }
  ~LiveInterfaces() override { close(control_); }

  void setUp(bool up) const {
    ifreq request = named("lo");
    request.ifr_flags = static_cast<short>(up ? IFF_UP : 0);
    ASSERT_EQ(ioctl(control_, SIOCSIFFLAGS, &request), 0) << strerror(errno);
  }
  /* Of the interface's second address, which takes the place of the one before. */
  void setAddress(const char *address) const {
    ifreq request = named("lo:1");
    auto *to = reinterpret_cast<sockaddr_in *>(&request.ifr_addr);
    to->sin_family = AF_INET;
    inet_pton(AF_INET, address, &to->sin_addr);
    ASSERT_EQ(ioctl(control_, SIOCSIFADDR, &request), 0) << strerror(errno);
  }

  /* Watches until the directory holds that, and does `act` meanwhile. */
  void changeUntil(const std::string &expected, const std::function<void()> &act) {
    std::promise<void> reached;
    std::once_flag once;
    source_->watch([&](const host::Difference &) {
      if (held() == expected) std::call_once(once, [&] { reached.set_value(); });
    });
    act();
    EXPECT_EQ(reached.get_future().wait_for(std::chrono::minutes(1)), std::future_status::ready)
        << expected << ", not " << held();
    source_.emplace(node_, directory_);
    source_->load();
  }

  /* The interface's health and its addresses but the loopback's own. */
  std::string held() const {
    const zel_UUID interface = host::namedUUID(node_.uuid, "lo");
    const auto health = directory_.entry(KARST_TYPE_HEALTH_STATUS, interface);
    const auto entry = directory_.entry(KARST_TYPE_NET_INTERFACE, interface);
    KarstHealthStatusEntry status{};
    KarstNetInterfaceEntry record{};
    if (!health || host::decode(health->data, &status) != ZEL_OK || !entry ||
        host::decode(entry->data, &record) != ZEL_OK) {
      return "nothing";
    }
    std::string text = status.healthFlags == 0 ? "up" : "down";
    for (uint32_t i = 0; i < record.numIpAddresses; i++) {
      char address[INET_ADDRSTRLEN] = "";
      inet_ntop(AF_INET, record.ipAddresses[i].address, address, sizeof address);
      if (record.ipAddresses[i].address[0] != 127) text += std::string(" ") + address;
    }
    return text;
  }

  static ifreq named(const char *name) {
    ifreq request{};
    std::strncpy(request.ifr_name, name, sizeof request.ifr_name - 1);
    return request;
  }

  const int control_ = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  host::OwnNode node_;
  host::Directory directory_;
  std::optional<host::OwnInterfacesSource> source_;
};

TEST_F(LiveInterfaces, AnInterfaceComesWithItsFirstAddressAndItsHealthFollowsTheCarrier) {
  source_->load();
  EXPECT_EQ(directory_.entries(KARST_TYPE_NODE).size(), 1u);
  EXPECT_EQ(held(), "nothing");
  changeUntil("up 192.0.2.1", [&] {
    setUp(true);
    setAddress("192.0.2.1");
  });
  changeUntil("down 192.0.2.1", [&] { setUp(false); });
  changeUntil("up 192.0.2.1", [&] { setUp(true); });
  changeUntil("up 192.0.2.2", [&] { setAddress("192.0.2.2"); });
}

/* More changes than the socket has room for, while nobody reads: the system drops messages. */
TEST_F(LiveInterfaces, WhatTheSystemCouldNotTellIsFoundAllTheSame) {
  setUp(true);
  source_->load();
  for (int i = 0; i < 20000; i++) setAddress(i % 2 ? "192.0.2.3" : "192.0.2.4");
  setAddress("192.0.2.5");
  changeUntil("up 192.0.2.5", [] {});
}

}  // namespace
