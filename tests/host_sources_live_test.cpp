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
    interface_ = host::namedUUID(node_.uuid, "lo");
  }
  ~LiveInterfaces() override { close(control_); }

  void setUp(bool up) const {
    ifreq request = named("lo");
    request.ifr_flags = static_cast<short>(up ? IFF_UP : 0);
    ASSERT_EQ(ioctl(control_, SIOCSIFFLAGS, &request), 0) << strerror(errno);
  }
  void setAddress(const char *label, const char *address) const {
    ifreq request = named(label);
    auto *to = reinterpret_cast<sockaddr_in *>(&request.ifr_addr);
    to->sin_family = AF_INET;
    inet_pton(AF_INET, address, &to->sin_addr);
    ASSERT_EQ(ioctl(control_, SIOCSIFADDR, &request), 0) << strerror(errno);
  }

  /* Watches until the directory holds what is asked for, and does `act` meanwhile. */
  void changeUntil(const std::function<bool()> &holds, const std::function<void()> &act) {
    std::promise<void> reached;
    std::once_flag once;
    source_->watch([&](const host::Difference &) {
      if (holds()) std::call_once(once, [&] { reached.set_value(); });
    });
    act();
    EXPECT_EQ(reached.get_future().wait_for(std::chrono::minutes(1)), std::future_status::ready);
    source_.emplace(node_, directory_);
    source_->load();
  }

  std::optional<uint32_t> healthFlags() const {
    KarstHealthStatusEntry record{};
    const auto held = directory_.entry(KARST_TYPE_HEALTH_STATUS, interface_);
    if (!held || host::decode(held->data, &record) != ZEL_OK) return std::nullopt;
    return record.healthFlags;
  }
  bool listsAddress(const char *text) const {
    KarstNetInterfaceEntry record{};
    const auto held = directory_.entry(KARST_TYPE_NET_INTERFACE, interface_);
    if (!held || host::decode(held->data, &record) != ZEL_OK) return false;
    in_addr wanted{};
    inet_pton(AF_INET, text, &wanted);
    for (uint32_t i = 0; i < record.numIpAddresses; i++) {
      if (std::memcmp(record.ipAddresses[i].address, &wanted, sizeof wanted) == 0) return true;
    }
    return false;
  }

  host::Directory directory_;

 private:
  static ifreq named(const char *name) {
    ifreq request{};
    std::strncpy(request.ifr_name, name, sizeof request.ifr_name - 1);
    return request;
  }

  const int control_ = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  host::OwnNode node_;
  zel_UUID interface_{};

 protected:
  std::optional<host::OwnInterfacesSource> source_;
};

TEST_F(LiveInterfaces, AnInterfaceComesWithItsFirstAddressAndItsHealthFollowsTheCarrier) {
  source_->load();
  EXPECT_EQ(directory_.entries(KARST_TYPE_NODE).size(), 1u);
  EXPECT_EQ(directory_.entries(KARST_TYPE_NET_INTERFACE).size(), 0u);

  changeUntil([&] { return listsAddress("192.0.2.1") && healthFlags() == 0; },
              [&] {
                setUp(true);
                setAddress("lo:1", "192.0.2.1");
              });
  changeUntil([&] { return healthFlags() == 1; }, [&] { setUp(false); });
  changeUntil([&] { return healthFlags() == 0; }, [&] { setUp(true); });
  changeUntil([&] { return listsAddress("192.0.2.2") && !listsAddress("192.0.2.1"); },
              [&] { setAddress("lo:1", "192.0.2.2"); });
}

/* More changes than the socket has room for, while nobody reads: the system drops messages. */
TEST_F(LiveInterfaces, WhatTheSystemCouldNotTellIsFoundAllTheSame) {
  setUp(true);
  source_->load();
  for (int i = 0; i < 20000; i++) setAddress("lo:2", i % 2 ? "192.0.2.3" : "192.0.2.4");
  setAddress("lo:2", "192.0.2.5");
  changeUntil([&] { return listsAddress("192.0.2.5"); }, [] {});
}

}  // namespace
