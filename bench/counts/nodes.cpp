/* What grows with the number of nodes that the directory has: creating an instance, and the rescan
 * after changes were lost, here of nodes and interfaces that are as they were. */
#include <stdexcept>

#include "bench/cluster.h"
#include "bench/counts/counts.h"
#include "karst_resolver/netif.h"
#include "karst_resolver/node.h"

namespace bench {
namespace {

constexpr size_t ROUNDS = 10;

/* The same number of times for each node, wherever it stands in the module's tree. */
void countCreate(Cluster &cluster, size_t nodes) {
  count(sized("Create and Destroy", "nodes", nodes), ROUNDS * nodes, [&] {
    for (size_t i = 0; i < ROUNDS * nodes; i++) {
      KARSTResolverInstance *instance = nullptr;
      const auto node = nodeUUID(static_cast<uint8_t>(i % nodes));
      if (cluster.create(&instance, 0, zel_UUID{}, node, false) != ZEL_OK) {
        throw std::runtime_error("an instance could not be made");
      }
      cluster.destroy(instance);
    }
  });
}

/* As the directory calls it, but on this thread. */
void countRescan(Cluster &cluster, size_t nodes) {
  auto *const nodesLost =
      cluster.inModule<decltype(KARSTResolverNodeSubCbk)>("KARSTResolverNodeSubCbk");
  auto *const interfacesLost =
      cluster.inModule<decltype(KARSTResolverNetIfSubCbk)>("KARSTResolverNetIfSubCbk");
  KARSTResolverCache *const cache = *cluster.inModule<KARSTResolverCache *>("karstResolverCache");
  count(sized("rescan of a node", "nodes", nodes), ROUNDS * nodes, [&] {
    for (size_t i = 0; i < ROUNDS; i++) nodesLost(cache, nullptr, nullptr, ZEL_SUB_RESYNC);
  });
  count(sized("rescan of an interface", "nodes", nodes), ROUNDS * nodes * INTERFACES_OF_A_NODE,
        [&] {
          for (size_t i = 0; i < ROUNDS; i++)
            interfacesLost(cache, nullptr, nullptr, ZEL_SUB_RESYNC);
        });
}

}  // namespace

void countNodes() {
  for (const uint8_t nodes : {8, 32, 128}) {
    Cluster cluster(nodes);
    countCreate(cluster, nodes);
    countRescan(cluster, nodes);
  }
}

}  // namespace bench
