/* A whole module in the simulator, driven step by step: what the tests of its promises share. */
#pragma once

#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <regex>
#include <string>
#include <vector>

#include "host/directory/records.h"
#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "karst_resolver/model.h"
#include "sim/simulation.h"
#include "tests/uuids.h"

/* A client: an instance and what its callback was told. */
struct Client {
  KARSTResolverInstance *instance = nullptr;
  std::vector<uint32_t> states; /* one a callback */
};

class Bench {
 public:
  explicit Bench(const sim::Settings &settings = defaults()) : sim(settings) {
    host::setLogSink(
        [this](const host::LogLine &line) {
          const std::string &text = line.text;
          if (text.starts_with("KARSTResolver: ")) {
            log.push_back(std::to_string(line.urgency) + " " +
                          std::regex_replace(text, std::regex(":[0-9]+: "), ":N: "));
          } else if (text.starts_with("heap ") || text.starts_with("lock domain ")) {
            leftBehind.push_back(text);
          }
        },
        true);
  }
  virtual ~Bench() {
    sim.clearFaults();
    sim.releaseAll();
    if (module != nullptr) unload();
    host::setLogSink(nullptr, false);
    EXPECT_THAT(leftBehind, ::testing::IsEmpty());
  }

  /* Two delivery threads, every trace class at level 2. */
  static sim::Settings defaults() {
    sim::Settings settings;
    settings.tracing.classLevel = 2;
    settings.tracing.throttling = false;
    return settings;
  }

  /* Loads the module; what() of the refusal, empty when it loaded. */
  std::string load(const std::vector<std::string> &parameters = {}) {
    try {
      module = &sim.load(KARST_RESOLVER_SO, parameters);
    } catch (const host::ModuleError &error) {
      return error.what();
    }
    create_ = internal<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
    destroy_ = internal<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy");
    setCallback_ = internal<decltype(KARSTResolver_SetCallback)>("KARSTResolver_SetCallback");
    read_ = internal<decltype(KARSTResolver_GetNodeLocators)>("KARSTResolver_GetNodeLocators");
    return "";
  }

  void unload() { sim.unload(*std::exchange(module, nullptr)); }

  /* Loaded, usable, self is node 1, everything taken in. */
  void start() {
    directory().setSelf(nodeUUID(1));
    directory().setUsable(true);
    ASSERT_EQ(load(), "");
    sim.run();
  }

  /* ---- The directory ------------------------------------------------------------------------- */

  host::Directory &directory() { return sim.directory(); }

  template <typename Record>
  void put(uint8_t type, const zel_UUID &uuid, const zel_UUID &owner, const Record &record) {
    directory().put({type, uuid, owner, host::encode(record)});
  }
  void putNode(uint32_t node, uint32_t major = 7, uint32_t minor = 1, uint32_t flags = 0) {
    put(KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), KarstNodeEntry{major, minor, flags, 1, 2});
  }
  void putNetIf(uint32_t netIf, uint32_t node, std::initializer_list<const char *> addresses,
                uint64_t trafficTypeMask = 0, uint32_t networkType = KARST_NETWORK_TYPE_IP) {
    KarstNetInterfaceEntry record{};
    record.networkType = networkType;
    record.trafficTypeMask = trafficTypeMask;
    for (const char *text : addresses) {
      KarstIpAddress &address = record.ipAddresses[record.numIpAddresses++];
      address.isIPv6 = std::string(text).find(':') != std::string::npos;
      EXPECT_EQ(inet_pton(address.isIPv6 ? AF_INET6 : AF_INET, text, address.address), 1) << text;
    }
    put(KARST_TYPE_NET_INTERFACE, netIfUUID(netIf), nodeUUID(node), record);
  }
  void putHealth(uint32_t netIf, uint32_t healthFlags, uint64_t timestamp = 1) {
    KarstHealthStatusEntry record{};
    record.healthFlags = healthFlags;
    record.timestamp = timestamp;
    put(KARST_TYPE_HEALTH_STATUS, netIfUUID(netIf), noUUID, record);
  }
  void putObject(uint32_t object, uint32_t node, uint8_t data = 0xa0) {
    directory().put({objectType, objectUUID(object), nodeUUID(node), {data}});
  }

  /* A node with one healthy interface of the same number, at 10.0.0.<number>. */
  void putSimpleNode(uint32_t number) {
    putNode(number);
    putHealth(number, 0);
    putNetIf(number, number, {("10.0.0." + std::to_string(number)).c_str()});
  }

  /* ---- Clients ------------------------------------------------------------------------------- */

  zel_Status create(Client &client, const zel_UUID &object, const zel_UUID &node,
                    bool useLocalLocator = false) {
    return sim.call("client", [&] {
      return create_(&client.instance, objectType, object, node, useLocalLocator);
    });
  }
  void setCallback(Client &client, bool install = true) {
    const KARSTResolverCallback told = [](void *data, KARSTResolverInstance *instance,
                                          uint32_t state) {
      auto *one = static_cast<Client *>(data);
      EXPECT_EQ(instance, one->instance);
      one->states.push_back(state);
    };
    sim.call("client", [&] { setCallback_(client.instance, install ? told : nullptr, &client); });
  }
  void destroy(Client &client) {
    sim.call("client", [&] { destroy_(std::exchange(client.instance, nullptr)); });
  }
  zel_Status read(const Client &client, KARSTResolverNodeLocators *set) {
    return sim.call("client", [&] { return read_(client.instance, set); });
  }

  /* ---- Inside -------------------------------------------------------------------------------- */

  /* By any name that the module's file has. */
  template <typename Symbol>
  Symbol *internal(const char *name) {
    return reinterpret_cast<Symbol *>(module->anySymbol(name));
  }
  KARSTResolverCache *cache() { return *internal<KARSTResolverCache *>("karstResolverCache"); }

  /* Events of the trace since the last call of this, in order. */
  std::vector<host::TracedRecord> traced() {
    std::vector<host::TracedRecord> found = host::readTrace(traceSeen_);
    if (!found.empty()) traceSeen_ = found.back().sequence + 1;
    return found;
  }

  std::vector<std::string> log;        /* the module's lines, with line numbers cut out */
  std::vector<std::string> leftBehind; /* in the module's heap and lock domain */
  sim::Simulation sim;
  host::Module *module = nullptr;
  decltype(KARSTResolver_Create) *create_ = nullptr;
  decltype(KARSTResolver_Destroy) *destroy_ = nullptr;
  decltype(KARSTResolver_SetCallback) *setCallback_ = nullptr;
  decltype(KARSTResolver_GetNodeLocators) *read_ = nullptr;

 private:
  uint64_t traceSeen_ = 0;
};

/* A test that has a bench of its own. */
class ModuleTest : public ::testing::Test, protected Bench {};
