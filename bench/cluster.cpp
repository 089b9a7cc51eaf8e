/* The host kernel, its nodes and their instances; see bench.h. */
#include <stdexcept>

#include "bench/cluster.h"
#include "host/directory/records.h"

namespace bench {
namespace {

enum : uint8_t { NODE = 1, INTERFACE = 2 };

zel_UUID uuidOf(uint8_t kind, uint8_t number) {
  zel_UUID uuid{};
  uuid.bytes[0] = kind;
  uuid.bytes[15] = number;
  return uuid;
}

host::KernelSettings settings() {
  host::KernelSettings settings;
  settings.tracing.throttling = false; /* a record for each event: that is what is measured */
  return settings;
}

host::Entry interfaceEntry(uint8_t number, uint8_t version) {
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  record.numIpAddresses = KARST_RESOLVER_MAX_LOCATORS;
  for (uint8_t i = 0; i < KARST_RESOLVER_MAX_LOCATORS; i++) {
    uint8_t *address = record.ipAddresses[i].address;
    address[0] = 10;
    address[1] = number;
    address[2] = version;
    address[3] = i;
  }
  return {KARST_TYPE_NET_INTERFACE, uuidOf(INTERFACE, number), uuidOf(NODE, number),
          host::encode(record)};
}

}  // namespace

Cluster::Cluster()
    : kernel(settings()),
      /* room for the instances of the largest node */
      module(kernel.modules().load(KARST_RESOLVER_SO, {"KARST_RESOLVER_LEAST_MAX_HEAP=0x8000000"})),
      create(inModule<decltype(KARSTResolver_Create)>("KARSTResolver_Create")),
      destroy(inModule<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy")),
      setCallback(inModule<decltype(KARSTResolver_SetCallback)>("KARSTResolver_SetCallback")),
      getNodeLocators(
          inModule<decltype(KARSTResolver_GetNodeLocators)>("KARSTResolver_GetNodeLocators")) {
  kernel.directory().setSelf(uuidOf(NODE, 0));
  kernel.directory().setUsable(true);
  kernel.settle();
}

void *Cluster::symbol(const char *name) const {
  void *const address = module.anySymbol(name);
  if (address == nullptr) throw std::runtime_error(std::string("the module has no ") + name);
  return address;
}

WatchedNode::WatchedNode(Cluster &cluster, uint8_t number, size_t instances)
    : cluster_(cluster), changes_{interfaceEntry(number, 1), interfaceEntry(number, 2)} {
  const zel_UUID node = uuidOf(NODE, number);
  host::Directory &directory = cluster.kernel.directory();
  directory.put({KARST_TYPE_NODE, node, node, host::encode(KarstNodeEntry{})});
  directory.put(interfaceEntry(number, 0));
  directory.put({KARST_TYPE_HEALTH_STATUS, uuidOf(INTERFACE, number), node,
                 host::encode(KarstHealthStatusEntry{})});
  cluster.kernel.settle();
  while (instances_.size() < instances) {
    KARSTResolverInstance *instance = nullptr;
    const zel_Status status = cluster.create(&instance, 0, zel_UUID{}, node, false);
    if (status != ZEL_OK) throw std::runtime_error(zel_StatusToString(status));
    cluster.setCallback(instance, instances_.empty() ? toldAndTimed : told, this);
    instances_.push_back(instance);
  }
}

WatchedNode::~WatchedNode() {
  for (KARSTResolverInstance *instance : instances_) cluster_.destroy(instance);
}

/* Calls of different instances come from one thread at a time, the resolver's: no need to add
 * atomically. */
void WatchedNode::told(void *data, KARSTResolverInstance *, uint32_t) {
  std::atomic<uint64_t> &calls = static_cast<WatchedNode *>(data)->calls_;
  calls.store(calls.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
}

void WatchedNode::toldAndTimed(void *data, KARSTResolverInstance *instance, uint32_t state) {
  static_cast<WatchedNode *>(data)->lastCall_ = Clock::now();
  told(data, instance, state);
}

}  // namespace bench
