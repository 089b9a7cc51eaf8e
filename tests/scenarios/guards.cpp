/* The table of guards, structure by structure as in karst_resolver/model.h. One OS thread, no lock. */
#include "tests/scenarios/guards.h"

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

template <size_t length>
std::string freeTag(const char (&text)[length]) {
  static_assert(length <= 9, "a tag has 8 bytes");
  std::string tag(8, '\0');
  for (size_t i = 0; i + 1 < length; ++i) tag[i] = text[i];
  for (char &character : tag) character = static_cast<char>(~character);
  return tag;
}

Structure nodeStructure() {
  using Node = KARSTResolverNode;
  return {
      .name = "KARSTResolverNode",
      .size = sizeof(Node),
      .lock = cacheLock,
      .fields = {FIELD(Node, tag, Lock), FIELD(Node, refCount, Lock), FIELD(Node, freeLinks, Lock),
                 FIELD(Node, dirtyLinks, Lock), FIELD(Node, treeElem, Lock), FIELD(Node, key, Lock),
                 FIELD(Node, uuid, Lock), FIELD(Node, isSelf, Lock), FIELD(Node, isWitness, Lock),
                 FIELD(Node, rescanSeen, Lock), FIELD(Node, reachable, Lock),
                 FIELD(Node, majorVersion, Lock), FIELD(Node, minorVersion, Lock),
                 FIELD(Node, netIfList, Lock), FIELD(Node, instanceList, Lock),
                 FIELD(Node, locators, Lock)}};
}

Structure netIfStructure() {
  using NetIf = KARSTResolverNetIf;
  return {
      .name = "KARSTResolverNetIf",
      .size = sizeof(NetIf),
      .lock = cacheLock,
      .fields = {FIELD(NetIf, tag, Lock), FIELD(NetIf, refCount, Lock),
                 FIELD(NetIf, cacheLinks, Lock), FIELD(NetIf, freeLinks, Lock),
                 FIELD(NetIf, nodeLinks, Lock), FIELD(NetIf, uuidString, Lock),
                 FIELD(NetIf, uuid, Lock), FIELD(NetIf, node, Lock), FIELD(NetIf, cache, Constant),
                 FIELD(NetIf, healthSub, Constant), FIELD(NetIf, healthSubInstalled, Lock),
                 FIELD(NetIf, healthy, Lock), FIELD(NetIf, rescanSeen, Lock),
                 FIELD(NetIf, info, Lock), FIELD(NetIf, health, Lock)}};
}

Structure cacheStructure() {
  using Cache = KARSTResolverCache;
  return {.name = "KARSTResolverCache",
          .size = sizeof(Cache),
          .lock = cacheLock,
          .fields = {FIELD(Cache, tag, Constant), FIELD(Cache, refCount, Atomic),
                     FIELD(Cache, enabled, Lock), FIELD(Cache, lock, Constant),
                     FIELD(Cache, world, Atomic), FIELD(Cache, selfUUID, Lock),
                     FIELD(Cache, nodeSub, Constant), FIELD(Cache, netIfSub, Constant),
                     FIELD(Cache, nodePool, Constant), FIELD(Cache, netIfPool, Constant),
                     FIELD(Cache, freeNodes, Lock), FIELD(Cache, freeNetIfs, Lock),
                     FIELD(Cache, nodeTree, Constant), FIELD(Cache, netIfs, Lock),
                     FIELD(Cache, dirtyNodes, Lock), FIELD(Cache, unwatchedNetIfs, Lock)},
          .exempt = {{"KARSTResolverCacheCleanup", 1, "the last reference on the cache is gone"},
                     {"KARSTResolverFillQuery", 1, "the first enable, before it subscribes"}}};
}

Structure treeStructure() {
  using Tree = KARSTRBTree;
  return {.name = "KARSTRBTree",
          .size = sizeof(Tree),
          .fields = {FIELD(Tree, alloc, Constant), FIELD(Tree, calloc, Constant),
                     FIELD(Tree, realloc, Constant), FIELD(Tree, free, Constant),
                     FIELD(Tree, base, Constant), FIELD(Tree, freeValFn, Constant),
                     FIELD(Tree, mpFreeValFn, Constant), FIELD(Tree, treeAllocated, Constant),
                     FIELD(Tree, data, Constant)}};
}

Structure treeDataStructure() {
  using Data = KARSTRBTreeData;
  return {.name = "KARSTRBTreeData",
          .size = sizeof(Data),
          .lock = cacheLock,
          .fields = {FIELD(Data, root, Lock), FIELD(Data, nil, Lock),
                     FIELD(Data, nilAllocated, Lock), FIELD(Data, count, Lock)},
          .exempt = {{"KARSTRBTree_FreeTree", 4, "the cache that the tree is of is at its end"}}};
}

Structure nilStructure() {
  using Nil = KARSTRBTreeNode;
  return {.name = "the tree's nil",
          .size = sizeof(Nil),
          .lock = cacheLock,
          .fields = {FIELD(Nil, parent, Lock), FIELD(Nil, left, Lock), FIELD(Nil, right, Lock),
                     FIELD(Nil, key, Lock), FIELD(Nil, word, Lock)},
          .exempt = {{"KARSTRBTree_FreeTree", 4, "the cache that the tree is of is at its end"}}};
}

Structure instanceStructure() {
  using Instance = KARSTResolverInstance;
  const char *const tracking = "written by tracking, whose calls for an instance never overlap";
  const char *const creator = "the creator's own, or whom the creator gave the instance to";
  return {.name = "KARSTResolverInstance",
          .size = sizeof(Instance),
          .lock = cacheLock,
          .ownLock = offsetof(Instance, lock),
          .fields = {FIELD(Instance, tag, Constant),
                     FIELD(Instance, refCount, Atomic),
                     FIELD(Instance, destroyed, OwnLock, nullptr, quickLook),
                     FIELD(Instance, nodeChanged, Lock, nullptr, quickLook),
                     FIELD(Instance, lock, Constant),
                     FIELD(Instance, name, Constant),
                     FIELD(Instance, objectUUID, Constant),
                     FIELD(Instance, hintNodeUUID, Constant),
                     FIELD(Instance, useHintNode, Free, tracking),
                     FIELD(Instance, useLocalLocator, Constant),
                     FIELD(Instance, entryType, Constant),
                     FIELD(Instance, objectQuery, Constant),
                     FIELD(Instance, subscribed, Free, creator),
                     FIELD(Instance, callback, OwnLock),
                     FIELD(Instance, callbackData, OwnLock),
                     FIELD(Instance, node, Lock, nullptr, quickLook),
                     FIELD(Instance, nodeLinks, Lock),
                     FIELD(Instance, state, Both),
                     FIELD(Instance, locators, Both),
                     FIELD(Instance, boundNodeUUID, Constant)},
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
  rules.object(treeDataStructure(), tree.data);
  rules.object(nilStructure(), reinterpret_cast<const void *>(tree.base + tree.data->nil));
  rules.pool(nodeStructure(),
             {.tag = {offsetof(KARSTResolverNode, tag), sizeof(KARSTResolverNode::tag)},
              .freeTag = freeTag(KARST_RESOLVER_TAG_NODE),
              .open = {{offsetof(KARSTResolverNode, freeLinks), sizeof(KARSTResolverLink)}}},
             cache.nodePool, KARST_RESOLVER_NODE_POOL_SIZE);
  rules.pool(netIfStructure(),
             {.tag = {offsetof(KARSTResolverNetIf, tag), sizeof(KARSTResolverNetIf::tag)},
              .freeTag = freeTag(KARST_RESOLVER_TAG_NETIF),
              .open = {{offsetof(KARSTResolverNetIf, freeLinks), sizeof(KARSTResolverLink)}}},
             cache.netIfPool, KARST_RESOLVER_NETIF_POOL_SIZE);
  rules.blocks(instanceStructure(), "KARSTResolver_Create");
}

void withdrawGuards(sim::Simulation &simulation) {
  if (sim::access::watching) simulation.watch().rules().clear();
}
