/* The table of guards, structure by structure as in karst_resolver/model.h. One OS thread, no lock. */
#include "tests/scenarios/guards.h"

#include <cstring>
#include <string>

#include "karst_resolver/model.h"
#include "sim/access/recorder.h"

using sim::access::Guard;
using sim::access::Structure;

namespace {

constexpr const char *cacheLock = "KARSTResolverCache";
constexpr const char *quickLook = "a quick look, which is decided again under the lock";

#define FIELD(Type, member, guard, ...) \
  { offsetof(Type, member), sizeof(Type::member), #member, Guard::guard, __VA_ARGS__ }

/* All from one member to another, as they stand in model.h. */
#define FIELDS(Type, first, last, guard)                                                      \
  {                                                                                           \
    offsetof(Type, first), offsetof(Type, last) + sizeof(Type::last) - offsetof(Type, first), \
        #first " to " #last, Guard::guard                                                     \
  }

std::string freeTag(const char *text) {
  std::string tag(8, '\0');
  tag.replace(0, std::strlen(text), text);
  for (char &character : tag) character = static_cast<char>(~character);
  return tag;
}

/* A slot of a pool, free while its tag says so. */
template <typename Slot>
sim::access::Slots slotsOf(const char *tag) {
  return {.tag = {offsetof(Slot, tag), sizeof(Slot::tag)},
          .freeTag = freeTag(tag),
          .open = {{offsetof(Slot, freeLinks), sizeof(KARSTResolverLink)}}};
}

Structure nodeStructure() {
  using Node = KARSTResolverNode;
  return {.name = "KARSTResolverNode",
          .size = sizeof(Node),
          .lock = cacheLock,
          .fields = {FIELDS(Node, tag, locators, Lock)}};
}

Structure netIfStructure() {
  using NetIf = KARSTResolverNetIf;
  return {.name = "KARSTResolverNetIf",
          .size = sizeof(NetIf),
          .lock = cacheLock,
          .fields = {FIELDS(NetIf, tag, node, Lock), FIELDS(NetIf, cache, healthSub, Constant),
                     FIELDS(NetIf, healthSubInstalled, health, Lock)}};
}

Structure cacheStructure() {
  using Cache = KARSTResolverCache;
  return {.name = "KARSTResolverCache",
          .size = sizeof(Cache),
          .lock = cacheLock,
          .fields = {FIELD(Cache, tag, Constant), FIELD(Cache, refCount, Atomic),
                     FIELD(Cache, enabled, Lock), FIELD(Cache, lock, Constant),
                     FIELD(Cache, world, Atomic), FIELD(Cache, selfUUID, Lock),
                     FIELDS(Cache, nodeSub, netIfPool, Constant),
                     FIELDS(Cache, freeNodes, freeNetIfs, Lock), FIELD(Cache, nodeTree, Constant),
                     FIELDS(Cache, netIfs, unwatchedNetIfs, Lock)},
          .exempt = {{"KARSTResolverCacheCleanup", 1, "the last reference on the cache is gone"},
                     {"KARSTResolverFillQuery", 1, "the first enable, before it subscribes"}}};
}

Structure treeStructure() {
  return {.name = "KARSTRBTree",
          .size = sizeof(KARSTRBTree),
          .fields = {FIELDS(KARSTRBTree, alloc, data, Constant)}};
}

/* What changes with the tree: its data, and the node that all leaves are. */
Structure treePart(const char *name, uint32_t size) {
  return {.name = name,
          .size = size,
          .lock = cacheLock,
          .fields = {{0, size, "any", Guard::Lock}},
          .exempt = {{"KARSTRBTree_FreeTree", 4, "the cache that the tree is of is at its end"}}};
}

Structure instanceStructure() {
  using Instance = KARSTResolverInstance;
  const char *const tracking = "written by tracking, whose calls for an instance never overlap";
  const char *const creator = "the creator's own, or whom the creator gave the instance to";
  return {
      .name = "KARSTResolverInstance",
      .size = sizeof(Instance),
      .lock = cacheLock,
      .ownLock = offsetof(Instance, lock),
      .fields = {FIELD(Instance, tag, Constant), FIELD(Instance, refCount, Atomic),
                 FIELD(Instance, destroyed, OwnLock, nullptr, quickLook),
                 FIELD(Instance, nodeChanged, Lock, nullptr, quickLook),
                 FIELDS(Instance, lock, hintNodeUUID, Constant),
                 FIELD(Instance, useHintNode, Free, tracking),
                 FIELDS(Instance, useLocalLocator, objectQuery, Constant),
                 FIELD(Instance, subscribed, Free, creator),
                 FIELDS(Instance, callback, callbackData, OwnLock),
                 FIELD(Instance, node, Lock, nullptr, quickLook), FIELD(Instance, nodeLinks, Lock),
                 FIELDS(Instance, state, locators, Both), FIELD(Instance, boundNodeUUID, Constant)},
      .exempt = {{"KARSTResolverReleaseInstance", 1, "the last reference is gone"}}};
}

/* A variable of the module. */
Structure variable(const char *name, uint32_t size, Guard guard, const char *reason = nullptr) {
  return {.name = name, .size = size, .fields = {{0, size, name, guard, reason}}};
}

}  // namespace

void declareVariableGuards(sim::Simulation &simulation, const host::Module &module) {
  if (!sim::access::watching) return;
  sim::access::Rules &rules = simulation.watch().rules();
  rules.object(variable("karstResolverCache", sizeof(KARSTResolverCache *), Guard::Free,
                        "written by loading and unloading, before and after everybody else"),
               module.anySymbol("karstResolverCache"));
  rules.object(variable("karstResolverInstancesAlive", sizeof(uint64_t), Guard::Atomic),
               module.anySymbol("karstResolverInstancesAlive"));
}

void declareCacheGuards(sim::Simulation &simulation, const KARSTResolverCache &cache) {
  if (!sim::access::watching) return;
  sim::access::Rules &rules = simulation.watch().rules();
  const KARSTRBTree &tree = *cache.nodeTree;
  rules.object(cacheStructure(), &cache);
  rules.object(treeStructure(), &tree);
  rules.object(treePart("KARSTRBTreeData", sizeof(KARSTRBTreeData)), tree.data);
  rules.object(treePart("the tree's nil", sizeof(KARSTRBTreeNode)),
               reinterpret_cast<const void *>(tree.base + tree.data->nil));
  rules.pool(nodeStructure(), slotsOf<KARSTResolverNode>(KARST_RESOLVER_TAG_NODE), cache.nodePool,
             KARST_RESOLVER_NODE_POOL_SIZE);
  rules.pool(netIfStructure(), slotsOf<KARSTResolverNetIf>(KARST_RESOLVER_TAG_NETIF),
             cache.netIfPool, KARST_RESOLVER_NETIF_POOL_SIZE);
  rules.blocks(instanceStructure(), "KARSTResolver_Create");
}

void withdrawGuards(sim::Simulation &simulation) {
  if (sim::access::watching) simulation.watch().rules().clear();
}
