#include "tests/module_fixture.h"

#include <arpa/inet.h>

#include <algorithm>
#include <regex>

std::vector<std::string> textsOf(const KARSTResolverNodeLocators &set) {
  std::vector<std::string> texts;
  for (uint16_t i = 0; i < set.count; i++) {
    const KARSTResolverNodeLocator &locator = set.locators[i];
    const bool isIPv6 = locator.networkType == KARST_RESOLVER_LOCATOR_IPV6;
    char text[INET6_ADDRSTRLEN] = "";
    EXPECT_TRUE(isIPv6 || locator.networkType == KARST_RESOLVER_LOCATOR_IPV4);
    texts.emplace_back(inet_ntop(isIPv6 ? AF_INET6 : AF_INET, locator.address, text, sizeof text));
  }
  return texts;
}

/* ---- Life ------------------------------------------------------------------------------------ */

sim::Settings ModuleTest::defaults() {
  sim::Settings settings;
  settings.tracing.classLevel = 2;
  settings.tracing.throttling = false;
  return settings;
}

ModuleTest::ModuleTest(const sim::Settings &settings) : sim(settings) {
  host::setLogSink(
      [this](const host::LogLine &line) {
        if (line.log.empty() &&
            (line.text.starts_with("heap ") || line.text.starts_with("lock domain "))) {
          leftBehind.push_back(line.text);
        }
        if (line.log != "KARSTResolver" && line.text.find("Failed to") == std::string::npos) return;
        log.push_back(std::to_string(line.urgency) + " " +
                      std::regex_replace(line.text, std::regex(":[0-9]+: "), ":N: "));
      },
      true);
}

ModuleTest::~ModuleTest() {
  sim.clearFaults();
  sim.releaseAll();
  if (module_ != nullptr) unload();
  host::setLogSink(nullptr, false);
  EXPECT_THAT(leftBehind, ::testing::IsEmpty());
}

std::string ModuleTest::load(const std::vector<std::string> &parameters) {
  try {
    module_ = &sim.load(KARST_RESOLVER_SO, parameters);
  } catch (const host::ModuleError &error) {
    return error.what();
  }
  create_ = module_->function<decltype(KARSTResolver_Create)>("KARSTResolver_Create");
  destroy_ = module_->function<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy");
  setCallback_ =
      module_->function<decltype(KARSTResolver_SetCallback)>("KARSTResolver_SetCallback");
  read_ =
      module_->function<decltype(KARSTResolver_GetNodeLocators)>("KARSTResolver_GetNodeLocators");
  return "";
}

void ModuleTest::unload() {
  sim.unload(*module_);
  module_ = nullptr;
}

void ModuleTest::start() {
  directory().setSelf(nodeUUID(1));
  directory().setUsable(true);
  ASSERT_EQ(load(), "");
  sim.run();
}

/* ---- Directory ------------------------------------------------------------------------------- */

void ModuleTest::putNode(uint32_t node, uint32_t major, uint32_t minor, uint32_t flags) {
  KarstNodeEntry record{major, minor, flags, 1, 2};
  putRaw(KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), host::encode(record));
}

KarstNetInterfaceEntry ModuleTest::netIfRecord(std::initializer_list<const char *> addresses) {
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  for (const char *text : addresses) {
    KarstIpAddress &address = record.ipAddresses[record.numIpAddresses++];
    address.isIPv6 = std::string(text).find(':') != std::string::npos;
    EXPECT_EQ(inet_pton(address.isIPv6 ? AF_INET6 : AF_INET, text, address.address), 1) << text;
  }
  return record;
}

void ModuleTest::putNetIf(uint32_t netIf, uint32_t node,
                          std::initializer_list<const char *> addresses, uint64_t trafficTypeMask) {
  KarstNetInterfaceEntry record = netIfRecord(addresses);
  record.trafficTypeMask = trafficTypeMask;
  putNetIf(netIf, node, record);
}

void ModuleTest::putNetIf(uint32_t netIf, uint32_t node, const KarstNetInterfaceEntry &record) {
  putRaw(KARST_TYPE_NET_INTERFACE, netIfUUID(netIf), nodeUUID(node), host::encode(record));
}

void ModuleTest::putHealth(uint32_t netIf, uint32_t healthFlags, uint64_t timestamp) {
  KarstHealthStatusEntry record{};
  record.healthFlags = healthFlags;
  record.timestamp = timestamp;
  putRaw(KARST_TYPE_HEALTH_STATUS, netIfUUID(netIf), noUUID, host::encode(record));
}

void ModuleTest::putObject(uint32_t object, uint32_t node) {
  putRaw(objectType, objectUUID(object), node == 0 ? noUUID : nodeUUID(node), {0xa0});
}

void ModuleTest::putRaw(uint8_t type, const zel_UUID &uuid, const zel_UUID &owner,
                        std::vector<uint8_t> data) {
  directory().put({type, uuid, owner, std::move(data)});
}

void ModuleTest::putSimpleNode(uint32_t number) {
  putNode(number);
  putHealth(number, 0);
  putNetIf(number, number, {("10.0.0." + std::to_string(number)).c_str()});
}

/* ---- Clients --------------------------------------------------------------------------------- */

zel_Status ModuleTest::create(Client &client, const zel_UUID &object, const zel_UUID &node,
                              bool useLocalLocator, uint32_t entryType) {
  return sim.call("client", [&] {
    return create_(&client.instance, entryType, object, node, useLocalLocator);
  });
}

void ModuleTest::setCallback(Client &client) {
  sim.call("client", [&] {
    setCallback_(
        client.instance,
        [](void *data, KARSTResolverInstance *instance, uint32_t state) KARST_UNCHECKED {
          auto *told = static_cast<Client *>(data);
          EXPECT_EQ(instance, told->instance);
          told->states.push_back(state);
          told->counts.push_back(instance->locators.count);
        },
        &client);
  });
}

void ModuleTest::removeCallback(Client &client) {
  sim.call("client", [&] { setCallback_(client.instance, nullptr, nullptr); });
}

void ModuleTest::destroy(Client &client) {
  sim.call("client", [&] { destroy_(client.instance); });
  client.instance = nullptr;
}

zel_Status ModuleTest::read(const Client &client, KARSTResolverNodeLocators *set) {
  return sim.call("client", [&] { return read_(client.instance, set); });
}

/* ---- Inside ---------------------------------------------------------------------------------- */

KARSTResolverCache *ModuleTest::cache() {
  return *static_cast<KARSTResolverCache **>(module_->anySymbol("karstResolverCache"));
}

KARSTResolverNode *ModuleTest::cachedNode(uint32_t number) {
  auto *find =
      internal<KARSTResolverNode *(KARSTResolverCache *, zel_UUID)>("KARSTResolverFindNodeLocked");
  return find(cache(), nodeUUID(number));
}

std::vector<KARSTResolverNetIf *> ModuleTest::cachedNetIfs() {
  std::vector<KARSTResolverNetIf *> found;
  for (auto *link = cache()->netIfs.next; link != &cache()->netIfs; link = link->next) {
    found.push_back(KARST_RESOLVER_CONTAINER(link, KARSTResolverNetIf, cacheLinks));
  }
  return found;
}

std::vector<host::TracedRecord> ModuleTest::traced() {
  std::vector<host::TracedRecord> found = host::readTrace(traceSeen_);
  if (!found.empty()) traceSeen_ = found.back().sequence + 1;
  return found;
}

std::vector<std::string> ModuleTest::calls(const std::vector<std::string> &which) {
  std::vector<std::string> found;
  for (const sim::HistoryEntry &entry : sim.history()) {
    const char *const name = sim::traits(entry.call).name;
    if (!entry.note && std::count(which.begin(), which.end(), name) != 0) found.emplace_back(name);
  }
  return found;
}
