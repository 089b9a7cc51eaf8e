/* A full rescan, when the directory says that changes were lost: 128 node entries and 512 interface
 * entries read and compared, beside the same reads and comparisons written out; and the cache filled
 * from cold. */
#include <cstdlib>
#include <cstring>
#include <memory>
#include <semaphore>

#include "bench/subjects.h"
#include "host/directory/marshaller.h"
#include "host/directory/records.h"
#include "karst_resolver/model.h"

namespace bench {
namespace {

constexpr size_t INTERFACES = NODES * INTERFACES_OF_A_NODE, ENTRIES = NODES + INTERFACES;

/* What the directory calls in the module, called directly, on this thread. */
struct Module {
  explicit Module(Cluster &cluster)
      : cache(*cluster.inModule<KARSTResolverCache *>("karstResolverCache")),
        nodesCalled(cluster.inModule<Callback>("KARSTResolverNodeSubCbk")),
        interfacesCalled(cluster.inModule<Callback>("KARSTResolverNetIfSubCbk")),
        findNode(cluster.inModule<FindNode>("KARSTResolverFindNodeLocked")),
        findInterface(cluster.inModule<FindInterface>("KARSTResolverFindNetIf")) {}

  void rescan() const {
    const KarstEntryHeader none{};
    nodesCalled(cache, &none, nullptr, ZEL_SUB_RESYNC);
    interfacesCalled(cache, &none, nullptr, ZEL_SUB_RESYNC);
  }

  using Callback = zel_Status(void *, const KarstEntryHeader *, void *, zel_Status);
  using FindNode = KARSTResolverNode *(KARSTResolverCache *, zel_UUID);
  using FindInterface = KARSTResolverNetIf *(KARSTResolverCache *, zel_UUID, zel_UUID);
  KARSTResolverCache *const cache;
  Callback *const nodesCalled, *const interfacesCalled;
  FindNode *const findNode;
  FindInterface *const findInterface;
};

/* One instance a node. */
struct Watched {
  explicit Watched(Cluster &cluster) {
    for (uint8_t node = 0; node < NODES; node++) {
      nodes.push_back(std::make_unique<WatchedNode>(cluster, node, 1));
    }
  }
  uint64_t calls() const {
    uint64_t all = 0;
    for (const auto &node : nodes) all += node->calls();
    return all;
  }
  Clock::time_point lastCall() const {
    Clock::time_point last{};
    for (const auto &node : nodes) last = std::max(last, node->lastCall());
    return last;
  }
  std::vector<std::unique_ptr<WatchedNode>> nodes;
};

/* ---- Nothing has changed --------------------------------------------------------------------- */

/* Adding to what a node's or an interface's change would make the world do is counted by its wakes. */
void unchanged(benchmark::State &state, Cluster &cluster) {
  const Module module(cluster);
  const Watched watched(cluster);
  cluster.kernel.settle();
  const uint64_t calls = watched.calls(), activity = host::worldsActivity();
  const uint64_t allocations = cluster.allocations();
  for (auto _ : state) module.rescan();
  cluster.kernel.settle();
  askCount("callbacks of an unchanged rescan", watched.calls() - calls, 0);
  askCount("wakes of the world for an unchanged rescan", host::worldsActivity() - activity, 0);
  askCount("allocations of an unchanged rescan beyond its 640 entries",
           cluster.allocations() - allocations - ENTRIES * state.iterations(), 0);
}

/* The entries as they stand in the directory, and the records that they held when last looked at. */
struct Replica {
  explicit Replica(Cluster &cluster)
      : nodes(cluster.kernel.directory().entries(KARST_TYPE_NODE)),
        interfaces(cluster.kernel.directory().entries(KARST_TYPE_NET_INTERFACE)),
        nodeRecords(nodes.size()),
        interfaceRecords(interfaces.size()) {}
  std::vector<host::Entry> nodes, interfaces;
  std::vector<KarstNodeEntry> nodeRecords;
  std::vector<KarstNetInterfaceEntry> interfaceRecords;
};

template <typename Record>
bool decodeEach(const std::vector<host::Entry> &entries, std::vector<Record> &records) {
  for (size_t i = 0; i < entries.size(); i++) {
    if (host::decode(entries[i].data, &records[i]) != ZEL_OK) return false;
  }
  return true;
}

/* The bytes are at hand: no directory is asked, nothing allocated, no lock taken. The finds are the
 * module's own, in its own map. */
bool compareEach(const Module &module, const Replica &replica) {
  bool same = true;
  for (size_t i = 0; i < replica.nodes.size(); i++) {
    const host::Entry &entry = replica.nodes[i];
    KarstNodeEntry record;
    same &= module.findNode(module.cache, entry.uuid) != nullptr &&
            host::decode(entry.data, &record) == ZEL_OK &&
            std::memcmp(&record, &replica.nodeRecords[i], sizeof record) == 0;
  }
  for (size_t i = 0; i < replica.interfaces.size(); i++) {
    const host::Entry &entry = replica.interfaces[i];
    KarstNetInterfaceEntry record;
    same &= module.findInterface(module.cache, entry.owner, entry.uuid) != nullptr &&
            host::decode(entry.data, &record) == ZEL_OK &&
            std::memcmp(&record, &replica.interfaceRecords[i], sizeof record) == 0;
  }
  return same;
}

void writtenOut(benchmark::State &state, Cluster &cluster) {
  const Module module(cluster);
  Replica replica(cluster);
  bool same = decodeEach(replica.nodes, replica.nodeRecords) &&
              decodeEach(replica.interfaces, replica.interfaceRecords);
  for (auto _ : state) same &= compareEach(module, replica);
  if (!same) state.SkipWithError("a record is not as it was");
}

constexpr ExprMshAllocator PLAIN = {[](void *, uint64_t size) { return std::malloc(size); },
                                    [](void *, uint64_t size) { return std::calloc(1, size); },
                                    [](void *, void *block) { std::free(block); }, nullptr};

/* The entries of a type, as a reader gets them from the directory: walked to one by one, and each
 * copied into a block, which is given back. */
template <typename Record, typename Find>
bool readEach(uint8_t type, const ExprMshField *table, const std::vector<Record> &records,
              const Find &find) {
  KarstQuery query{};
  query.type = type;
  query.flags = KARST_QUERY_BY_TYPE | KARST_QUERY_ALL;
  KarstEntryHeader header;
  size_t count = 0;
  while (KARST_FindEntry(&query, count == 0 ? 0 : 1, &header, sizeof header) == ZEL_OK) {
    KarstQuery one{};
    one.type = type;
    one.flags = KARST_QUERY_BY_TYPE;
    one.uuid = header.uuid;
    KarstFullEntry *entry;
    Record record{};
    if (find(header) == nullptr || KARST_FindFullEntryByQuery(&one, 0, &PLAIN, &entry) != ZEL_OK) {
      return false;
    }
    const zel_Status status = host::unmarshal(table, entry + 1, entry->header.dataLength, &record);
    std::free(entry);
    if (status != ZEL_OK || std::memcmp(&record, &records[count++], sizeof record) != 0)
      return false;
  }
  return count == records.size();
}

void readOut(benchmark::State &state, Cluster &cluster) {
  const Module module(cluster);
  Replica replica(cluster);
  bool same = decodeEach(replica.nodes, replica.nodeRecords) &&
              decodeEach(replica.interfaces, replica.interfaceRecords);
  for (auto _ : state) {
    same &= readEach(KARST_TYPE_NODE, host::nodeRecordTable, replica.nodeRecords,
                     [&](auto &header) { return module.findNode(module.cache, header.uuid); });
    same &= readEach(KARST_TYPE_NET_INTERFACE, host::netInterfaceRecordTable,
                     replica.interfaceRecords, [&](auto &header) {
                       return module.findInterface(module.cache, header.owner, header.uuid);
                     });
  }
  if (!same) state.SkipWithError("a record is not as it was");
}

void decodeAlone(benchmark::State &state, Cluster &cluster) {
  Replica replica(cluster);
  bool decoded = true;
  for (auto _ : state) {
    decoded &= decodeEach(replica.nodes, replica.nodeRecords) &&
               decodeEach(replica.interfaces, replica.interfaceRecords);
    benchmark::ClobberMemory();
  }
  if (!decoded) state.SkipWithError("a record cannot be decoded");
}

/* ---- All has changed ------------------------------------------------------------------------- */

/* Keeps every delivery thread inside a callback: what the directory is told meanwhile reaches nobody
 * before the end. */
class HeldDelivery {
 public:
  explicit HeldDelivery(Cluster &cluster)
      : directory_(cluster.kernel.directory()),
        queries_(cluster.kernel.settings().directory.deliveryThreads) {
    for (KarstQuery &query : queries_) { /* of what is not there, which is told at once */
      query.type = UNUSED_TYPE;
      query.flags = KARST_QUERY_BY_TYPE;
      query.uuid.bytes[0] = 1;
      directory_.subscribe(&query, hold, this);
    }
    for (size_t i = 0; i < queries_.size(); i++) held_.acquire();
  }
  ~HeldDelivery() {
    for (KarstQuery &query : queries_) directory_.unsubscribe(&query, hold, this);
    release_.release(static_cast<ptrdiff_t>(queries_.size()));
    directory_.waitUntilIdle();
  }
  HeldDelivery(const HeldDelivery &) = delete;
  HeldDelivery &operator=(const HeldDelivery &) = delete;

 private:
  static constexpr uint8_t UNUSED_TYPE = 200;

  static zel_Status hold(void *data, const KarstEntryHeader *, void *, zel_Status status) {
    auto *self = static_cast<HeldDelivery *>(data);
    if (status == ZEL_SUB_CANCELLED) return ZEL_OK;
    self->held_.release();
    self->release_.acquire();
    return ZEL_OK;
  }

  host::Directory &directory_;
  std::vector<KarstQuery> queries_;
  std::counting_semaphore<> held_{0}, release_{0};
};

/* Each interface has other addresses than before, and nobody has been told. */
void changed(benchmark::State &state, Cluster &cluster) {
  const Module module(cluster);
  const Watched watched(cluster);
  static uint8_t version = 4; /* of all addresses: 4 or 5 */
  for (auto _ : state) {
    version ^= 1;
    const uint64_t calls = watched.calls();
    {
      const HeldDelivery held(cluster);
      for (uint8_t node = 0; node < NODES; node++) {
        for (uint8_t interface = 0; interface < INTERFACES_OF_A_NODE; interface++) {
          cluster.kernel.directory().put(interfaceEntry(node, interface, version));
        }
      }
      const Clock::time_point start = Clock::now();
      module.rescan();
      state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    }
    cluster.kernel.settle();
    if (watched.calls() != calls + NODES) return state.SkipWithError("not each called once");
  }
}

/* ---- From cold ------------------------------------------------------------------------------- */

/* To the last callback: the world starts, 128 nodes and 512 interfaces are told of and read, with their
 * health, and 128 instances refreshed. */
void enable(benchmark::State &state, Cluster &cluster) {
  const Watched watched(cluster);
  for (auto _ : state) {
    cluster.kernel.directory().setUsable(false);
    cluster.kernel.settle();
    const uint64_t calls = watched.calls();
    const Clock::time_point start = Clock::now();
    cluster.kernel.directory().setUsable(true);
    cluster.kernel.settle();
    if (watched.calls() < calls + NODES) return state.SkipWithError("not each was called");
    state.SetIterationTime(std::chrono::duration<double>(watched.lastCall() - start).count());
  }
}

}  // namespace

void measureRescan(Cluster &cluster) {
  const std::string work = "rescan, 640 entries unchanged", peer = "written out, bytes at hand",
                    least = limit("written out, read from the directory");
  measure({work}, [&cluster](auto &state) { unchanged(state, cluster); });
  measure({work, peer}, [&cluster](auto &state) { writtenOut(state, cluster); });
  measure({work, limit("decode")}, [&cluster](auto &state) { decodeAlone(state, cluster); });
  measure({work, least}, [&cluster](auto &state) { readOut(state, cluster); });
  ask(work, 1.3, {peer});
  nameFloor(work, least);
  measure({"rescan, 512 of 640 entries changed"}, [&cluster](auto &state) {
    changed(state, cluster);
  })->UseManualTime();
  measure({"enable, to the last callback"}, [&cluster](auto &state) {
    enable(state, cluster);
  })->UseManualTime();
}

}  // namespace bench
