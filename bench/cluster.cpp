/* The host kernel, its nodes and their instances; see bench.h. */
#include <stdexcept>

#include "bench/cluster.h"
#include "host/directory/records.h"

namespace bench {
namespace {

enum : uint8_t { NODE = 1, INTERFACE = 2 };

zel_UUID uuidOf(uint8_t kind, uint8_t number, uint8_t below = 0) {
  zel_UUID uuid{};
  uuid.bytes[0] = kind;
  uuid.bytes[14] = number;
  uuid.bytes[15] = below;
  return uuid;
}

host::KernelSettings settings() {
  host::KernelSettings settings;
  settings.tracing.throttling = false; /* a record for each event: that is what is measured */
  return settings;
}

}  // namespace

zel_UUID nodeUUID(uint8_t node) {
  return uuidOf(NODE, node);
}

zel_UUID interfaceUUID(uint8_t node, uint8_t interface) {
  return uuidOf(INTERFACE, node, interface);
}

host::Entry nodeEntry(uint8_t node) {
  return {KARST_TYPE_NODE, nodeUUID(node), nodeUUID(node), host::encode(KarstNodeEntry{})};
}

host::Entry interfaceEntry(uint8_t node, uint8_t interface, uint8_t version) {
  KarstNetInterfaceEntry record{};
  record.networkType = KARST_NETWORK_TYPE_IP;
  record.numIpAddresses = KARST_RESOLVER_MAX_LOCATORS;
  for (uint8_t i = 0; i < KARST_RESOLVER_MAX_LOCATORS; i++) {
    uint8_t *address = record.ipAddresses[i].address;
    address[0] = 10;
    address[1] = node;
    address[2] = version;
    address[3] = static_cast<uint8_t>(interface * KARST_RESOLVER_MAX_LOCATORS + i);
  }
  return {KARST_TYPE_NET_INTERFACE, interfaceUUID(node, interface), nodeUUID(node),
          host::encode(record)};
}

host::Entry healthEntry(uint8_t node, uint8_t interface) {
  return {KARST_TYPE_HEALTH_STATUS, interfaceUUID(node, interface), nodeUUID(node),
          host::encode(KarstHealthStatusEntry{})};
}

Cluster::Cluster(uint8_t nodes)
    : kernel(settings()),
      /* room for the instances of the largest node */
      module(kernel.modules().load(KARST_RESOLVER_SO, {"KARST_RESOLVER_LEAST_MAX_HEAP=0x8000000"})),
      create(inModule<decltype(KARSTResolver_Create)>("KARSTResolver_Create")),
      destroy(inModule<decltype(KARSTResolver_Destroy)>("KARSTResolver_Destroy")),
      setCallback(inModule<decltype(KARSTResolver_SetCallback)>("KARSTResolver_SetCallback")),
      getNodeLocators(
          inModule<decltype(KARSTResolver_GetNodeLocators)>("KARSTResolver_GetNodeLocators")) {
  host::Directory &directory = kernel.directory();
  directory.setSelf(nodeUUID(0));
  for (uint8_t node = 0; node < nodes; node++) {
    directory.put(nodeEntry(node));
    for (uint8_t interface = 0; interface < INTERFACES_OF_A_NODE; interface++) {
      directory.put(interfaceEntry(node, interface, 0));
      directory.put(healthEntry(node, interface));
    }
  }
  directory.setUsable(true);
  kernel.settle();
}

host::HeapState Cluster::heap() const {
  return host::heapState(*inModule<zel_HeapID>("karstResolverHeapID"));
}

void *Cluster::symbol(const char *name) const {
  void *const address = module.anySymbol(name);
  if (address == nullptr) throw std::runtime_error(std::string("the module has no ") + name);
  return address;
}

WatchedNode::WatchedNode(Cluster &cluster, uint8_t number, size_t instances)
    : cluster_(cluster), changes_{interfaceEntry(number, 0, 1), interfaceEntry(number, 0, 2)} {
  /* Others may have had the node before. */
  const auto present = cluster.kernel.directory().entry(changes_[0].type, changes_[0].uuid);
  if (present == changes_[0]) changed_ = 1;
  while (instances_.size() < instances) {
    KARSTResolverInstance *instance = nullptr;
    const zel_Status status = cluster.create(&instance, 0, zel_UUID{}, nodeUUID(number), false);
    if (status != ZEL_OK) throw std::runtime_error(zel_StatusToString(status));
    const bool timed = instances_.empty() || instances_.size() + 1 == instances;
    instances_.push_back(instance);
    cluster.setCallback(instance, timed ? toldAndTimed : told, this);
  }
}

WatchedNode::~WatchedNode() {
  for (KARSTResolverInstance *instance : instances_) cluster_.destroy(instance);
}

bool WatchedNode::change(Clock::time_point *start) {
  host::Entry entry = nextChange();
  const uint64_t before = calls_;
  *start = Clock::now();
  cluster_.kernel.directory().put(std::move(entry));
  cluster_.kernel.settle();
  return calls_ == before + instances_.size();
}

/* The list is walked from either end in turn. */
Clock::duration WatchedNode::span() const {
  const Clock::time_point first = first_, last = last_;
  return first < last ? last - first : first - last;
}

/* Calls of different instances come from one thread at a time, the resolver's: no need to add
 * atomically. */
void WatchedNode::told(void *data, KARSTResolverInstance *, uint32_t) {
  std::atomic<uint64_t> &calls = static_cast<WatchedNode *>(data)->calls_;
  calls.store(calls.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
}

void WatchedNode::toldAndTimed(void *data, KARSTResolverInstance *instance, uint32_t state) {
  auto *node = static_cast<WatchedNode *>(data);
  const Clock::time_point now = Clock::now();
  (instance == node->instance() ? node->first_ : node->last_) = now;
  told(data, instance, state);
}

}  // namespace bench
