/* What the module takes: bytes a node, an interface and an instance, its code, its stack; and that
 * nothing is asked of the heap where nothing has to be. */
#include <cstdio>
#include <regex>

#include "bench/subjects.h"
#include "karst_resolver/model.h"

namespace bench {
namespace {

enum : uint8_t { NODE = 40, FLEETING_NODE = 41 };

constexpr size_t MOST_TEXT = 24576; /* bytes */
constexpr size_t INSTANCES = 1000, TIMES = 100;

/* ---- Bytes ----------------------------------------------------------------------------------- */

/* Each pool is one block; its slots share what the heap adds to it. */
template <typename Slot>
void stateSlot(const host::HeapState &heap, const std::string &what, uint32_t slots) {
  for (const host::HeapBlock &block : heap.blocks) {
    if (block.size != slots * sizeof(Slot)) continue;
    state(what, static_cast<double>(host::heapSpaceFor(block.size)) / slots, "bytes");
    state(what + ", " + limit("the structure"), sizeof(Slot), "bytes");
  }
}

void stateHeap(Cluster &cluster) {
  const host::HeapState heap = cluster.heap();
  stateSlot<KARSTResolverNode>(heap, "a node", KARST_RESOLVER_NODE_POOL_SIZE);
  stateSlot<KARSTResolverNetIf>(heap, "an interface", KARST_RESOLVER_NETIF_POOL_SIZE);
  const WatchedNode instances(cluster, NODE, INSTANCES);
  state("an instance", static_cast<double>(cluster.heap().used - heap.used) / INSTANCES, "bytes");
  state("an instance, " + limit("the structure"), sizeof(KARSTResolverInstance), "bytes");
  state("128 nodes and 512 interfaces, at rest", heap.used, "bytes");
  state("128 nodes and 512 interfaces, peak since load", heap.peak, "bytes");
}

/* ---- Code and stack -------------------------------------------------------------------------- */

double figureIn(const std::string &text, const std::string &pattern) {
  std::smatch found;
  if (!std::regex_search(text, found, std::regex(pattern))) {
    throw std::runtime_error("tools/check-module says nothing of " + pattern + ": " + text);
  }
  return std::stod(found[1]);
}

/* As the tool finds them in the module's file. */
void stateCode() {
  FILE *tool = popen(KARST_CHECK_MODULE " " KARST_RESOLVER_SO, "r");
  if (tool == nullptr) throw std::runtime_error("tools/check-module cannot be run");
  std::string said;
  for (int character; (character = std::fgetc(tool)) != EOF;) said += static_cast<char>(character);
  if (pclose(tool) != 0) throw std::runtime_error("tools/check-module refuses the module: " + said);
  askCount("bytes of the module's text",
           static_cast<uint64_t>(figureIn(said, R"(\.text (\d+) bytes)")), MOST_TEXT);
  state("deepest stack of the module", figureIn(said, R"(deepest stack (\d+) bytes)"), "bytes");
}

/* ---- Allocations ----------------------------------------------------------------------------- */

/* Does the work many times, lets all settle after each, and asks for no block but the directory's: one
 * for each entry that is read. */
template <typename Work>
void askAllocations(Cluster &cluster, const std::string &text, size_t entries, Work work) {
  const uint64_t before = cluster.allocations();
  for (size_t i = 0; i < TIMES; i++) {
    work();
    cluster.kernel.settle();
  }
  askCount("blocks beyond the directory's entries: " + text,
           cluster.allocations() - before - TIMES * entries, 0);
}

void askDirectoryEvents(Cluster &cluster, WatchedNode &node) {
  host::Directory &directory = cluster.kernel.directory();
  askAllocations(cluster, "an interface changes, 1000 are refreshed", 1,
                 [&] { directory.put(node.nextChange()); });
  host::Entry ill = healthEntry(NODE, 0);
  ill.data.assign({0xa0}); /* an empty map: another entry, the same record */
  askAllocations(cluster, "the health of an interface", 2, [&] {
    directory.put(ill);
    directory.put(healthEntry(NODE, 0));
  });
  /* Gone and back: a node's entry, and of each interface its own and its health, which is read when
   * the interface is made and when its health is followed. */
  askAllocations(cluster, "a node goes and comes", 1 + 3 * INTERFACES_OF_A_NODE, [&] {
    for (uint8_t i = 0; i < INTERFACES_OF_A_NODE; i++) {
      directory.remove(KARST_TYPE_NET_INTERFACE, interfaceUUID(FLEETING_NODE, i));
    }
    directory.remove(KARST_TYPE_NODE, nodeUUID(FLEETING_NODE));
    cluster.kernel.settle();
    directory.put(nodeEntry(FLEETING_NODE));
    for (uint8_t i = 0; i < INTERFACES_OF_A_NODE; i++) {
      directory.put(interfaceEntry(FLEETING_NODE, i, 0));
    }
  });
}

void askClients(Cluster &cluster, WatchedNode &node) {
  askAllocations(cluster, "reading out, setting a callback", 0, [&] {
    KARSTResolverNodeLocators read{};
    read.capacity = KARST_RESOLVER_MAX_LOCATORS;
    cluster.getNodeLocators(node.instance(), &read);
    cluster.setCallback(node.instance(), nullptr, nullptr);
  });
}

}  // namespace

void measureMemory(Cluster &cluster) {
  stateCode();
  stateHeap(cluster);
  WatchedNode node(cluster, NODE, INSTANCES);
  askDirectoryEvents(cluster, node);
  askClients(cluster, node);
}

}  // namespace bench
