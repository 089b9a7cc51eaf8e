/* Two pictures, of the cache and of what the directory says, in the same words; see directory_view.h.
 * Calls nothing of the module, takes no lock. */
#include "tests/directory_view.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <set>
#include <string_view>

#include "host/directory/records.h"
#include "host/kernel/text.h"

namespace {

using Lines = std::vector<std::string>;
using Picture = std::map<std::string, std::string>; /* what there is, and how it is */
using Nodes = std::vector<const KARSTResolverNode *>;
using NetIfs = std::vector<const KARSTResolverNetIf *>;
using host::formatText;
using host::toString;

/* ---- What the cache consists of -------------------------------------------------------------- */

bool isTag(const char *tag, const char *text, bool isFree = false) {
  uint64_t found, wanted;
  std::memcpy(&found, tag, sizeof found);
  std::memcpy(&wanted, text, sizeof wanted);
  return found == (isFree ? ~wanted : wanted);
}

/* The structures on a list, whose links must lead the same way forth and back. `name` is asked for
 * the list's when they don't. */
template <typename Element, typename Name>
std::vector<const Element *> elementsOf(const KARSTResolverLink &head, size_t offset,
                                        const Name &name, Lines &lines) {
  std::vector<const Element *> elements;
  elements.reserve(32);
  const KARSTResolverLink *previous = &head;
  const KARSTResolverLink *link = head.next;
  while (link != &head && link != nullptr && link->previous == previous && elements.size() < 1000) {
    elements.push_back(
        reinterpret_cast<const Element *>(reinterpret_cast<const uint8_t *>(link) - offset));
    previous = link;
    link = link->next;
  }
  if (link != &head || head.previous != previous) lines.push_back(name() + ": a broken list");
  return elements;
}

NetIfs netIfsOf(const KARSTResolverNode &node, Lines &lines) {
  return elementsOf<KARSTResolverNetIf>(
      node.netIfList, offsetof(KARSTResolverNetIf, nodeLinks),
      [&] { return "interfaces of node " + toString(node.uuid); }, lines);
}

NetIfs netIfsOf(const KARSTResolverCache *cache, Lines &lines) {
  return elementsOf<KARSTResolverNetIf>(
      cache->netIfs, offsetof(KARSTResolverNetIf, cacheLinks),
      [] { return std::string("interfaces"); }, lines);
}

/* How many black nodes every path below a link passes, and the nodes in order; -1: it is no such
 * tree, or one whose keys are not the nodes' own. */
int blackHeight(const KARSTRBTree *tree, uint64_t link, uint64_t parent, bool belowRed,
                Nodes &nodes) {
  if (link == tree->data->nil) return 0;
  const auto *element = reinterpret_cast<const KARSTRBTreeNode *>(tree->base + link);
  const auto *node = KARST_RESOLVER_CONTAINER(element, const KARSTResolverNode, treeElem);
  const bool isRed = (element->word & KARSTRBTREE_NODE_RED) != 0;
  if ((isRed && belowRed) || element->parent != parent || nodes.size() > tree->data->count ||
      tree->base + element->key != reinterpret_cast<uint64_t>(&node->key) ||
      node->key.kind != KARSTRBTREE_KEY_UUID || node->key.uuid != &node->uuid) {
    return -1;
  }
  const int left = blackHeight(tree, element->left, link, isRed, nodes);
  nodes.push_back(node);
  const int right = blackHeight(tree, element->right, link, isRed, nodes);
  return left < 0 || left != right ? -1 : left + !isRed;
}

/* In order. The root is as little red as a child of a red node. */
Nodes nodesOf(const KARSTResolverCache *cache, Lines &lines) {
  const KARSTRBTree *tree = cache->nodeTree;
  Nodes nodes;
  const int height = blackHeight(tree, tree->data->root, tree->data->nil, true, nodes);
  const auto outOfOrder = [](const KARSTResolverNode *a, const KARSTResolverNode *b) {
    return KARSTRBTreeCompareId(a->uuid.bytes, b->uuid.bytes) >= 0;
  };
  if (height < 0 || nodes.size() != tree->data->count ||
      std::adjacent_find(nodes.begin(), nodes.end(), outOfOrder) != nodes.end()) {
    lines.push_back("node tree: broken");
  }
  return nodes;
}

/* But for the tag and the place on the free list. */
template <typename Slot>
bool isEmpty(const Slot &slot) {
  static constexpr Slot empty{};
  constexpr size_t links = offsetof(Slot, freeLinks), behind = links + sizeof empty.freeLinks;
  const auto same = [&](size_t from, size_t to) {
    return std::memcmp(reinterpret_cast<const uint8_t *>(&slot) + from,
                       reinterpret_cast<const uint8_t *>(&empty) + from, to - from) == 0;
  };
  return same(sizeof empty.tag, links) && same(behind, sizeof empty);
}

/* Every slot is in use and known, or free, listed and, as far as it is looked into, empty. */
template <typename Slot>
void checkSlots(const Slot *pool, uint32_t size, const char *tag,
                const std::vector<const Slot *> &used, const KARSTResolverLink &freeList,
                const SlotSample &sample, Lines &lines) {
  const auto what = [&] { return std::string(tag, 8) + " slots"; };
  const auto free = elementsOf<Slot>(freeList, offsetof(Slot, freeLinks), what, lines);
  const auto placesOf = [&](const std::vector<const Slot *> &slots) {
    std::vector<char> places(size);
    for (const Slot *slot : slots) {
      if (slot >= pool && slot < pool + size) places[static_cast<size_t>(slot - pool)] = true;
    }
    return places;
  };
  const std::vector<char> listed = placesOf(free), inUse = placesOf(used);
  for (uint32_t i = 0; i < size; i++) {
    const bool lookInto = !inUse[i] && i % sample.step == sample.first;
    if (listed[i] == inUse[i] || !isTag(pool[i].tag, tag, !inUse[i]) ||
        (lookInto && !isEmpty(pool[i]))) {
      lines.push_back(formatText("%s: %u is neither in use nor free", what().c_str(), i));
    }
  }
  if (free.size() + used.size() != size) lines.push_back(what() + ": some are not in the pool");
}

/* ---- Pictures -------------------------------------------------------------------------------- */

/* What a client may rely on: of an IPv4 address four bytes count. */
std::string textOf(const KARSTResolverNodeLocators &set) {
  std::string text = fmt::format("{}, version {}.{}, traffic {},", toString(set.nodeUUID),
                                 set.majorVersion, set.minorVersion, set.trafficType);
  for (uint16_t i = 0; i < std::min<uint16_t>(set.count, KARST_RESOLVER_MAX_LOCATORS); i++) {
    const KARSTResolverNodeLocator &locator = set.locators[i];
    const size_t lengths[] = {0, 4, 16, 0}; /* by network type */
    const uint8_t *end = locator.address + lengths[locator.networkType & 3];
    text += fmt::format(" {}:{:02x}", locator.networkType, fmt::join(locator.address, end, ""));
  }
  return text;
}

std::string textOfCache(bool enabled, uint64_t references, const zel_UUID &self) {
  return fmt::format("enabled {:d}, references {}, self {}", enabled, references, toString(self));
}

std::string textOf(const KARSTResolverNode &node, size_t netIfs, size_t instances) {
  return fmt::format(
      "references {}, interfaces {}, instances {}, reachable {}, self {}, witness {}, mark of a "
      "rescan {}, room for {} locators, version {}.{}, {}",
      node.refCount, netIfs, instances, node.reachable, node.isSelf, node.isWitness,
      node.rescanSeen, node.locators.capacity, node.majorVersion, node.minorVersion,
      textOf(node.locators));
}

/* Of the records the hash: enough to tell them apart. */
std::string textOf(const KARSTResolverNetIf &netIf) {
  const auto hashOf = [](const auto &record) {
    return std::hash<std::string_view>()({reinterpret_cast<const char *>(&record), sizeof record});
  };
  return fmt::format(
      "references {}, record {:x}, health record {:x}, healthy {}, health subscription {}, mark of "
      "a rescan {}",
      netIf.refCount, hashOf(netIf.info), hashOf(netIf.health), netIf.healthy,
      netIf.healthSubInstalled, netIf.rescanSeen);
}

std::string textOf(const KARSTResolverInstance &instance, uint32_t told) {
  return fmt::format("references {}, destroyed {}, tracks {}, state {}, callback was told {}, {}",
                     instance.refCount, instance.destroyed,
                     toString(instance.node ? instance.node->uuid : zel_UUID{}), instance.state,
                     told, textOf(instance.locators));
}

std::string nodeName(const zel_UUID &uuid) {
  return "node " + toString(uuid);
}

std::string netIfName(const zel_UUID &owner, const zel_UUID &uuid) {
  return "interface " + toString(uuid) + " of " + toString(owner);
}

Picture pictureOf(const KARSTResolverCache *cache, const DirectoryView &view, Lines &lines) {
  Picture picture{{"cache", textOfCache(cache->enabled, cache->refCount, cache->selfUUID)}};
  for (const KARSTResolverNode *node : nodesOf(cache, lines)) {
    const auto instances = elementsOf<KARSTResolverInstance>(
        node->instanceList, offsetof(KARSTResolverInstance, nodeLinks),
        [&] { return "instances of " + nodeName(node->uuid); }, lines);
    picture[nodeName(node->uuid)] = textOf(*node, netIfsOf(*node, lines).size(), instances.size());
  }
  for (const KARSTResolverNetIf *netIf : netIfsOf(cache, lines)) {
    const zel_UUID owner = netIf->node ? netIf->node->uuid : zel_UUID{};
    picture[netIfName(owner, netIf->uuid)] = textOf(*netIf);
  }
  for (const DirectoryView::Instance &one : view.instances) {
    const KARSTResolverInstance &instance = *one.held.instance;
    picture[instance.name] = textOf(instance, one.held.told.value_or(instance.state));
  }
  return picture;
}

/* ---- The picture that the directory gives ---------------------------------------------------- */

/* Of each structure a copy, in which all that the directory decides is as it says. */
class Expected {
 public:
  Expected(const KARSTResolverCache *cache, const DirectoryView &view, Lines &lines)
      : view_(view), lines_(lines) {
    for (const KARSTResolverNode *node : nodesOf(cache, lines)) cached_[node->uuid] = node;
  }

  Picture picture() {
    const uint64_t references = 2 + view_.netIfs.size() + view_.instances.size();
    Picture picture{{"cache", textOfCache(true, references, view_.self)}};
    std::set<zel_UUID> nodes;
    for (const auto &[uuid, record] : view_.nodes) nodes.insert(uuid);
    for (const auto &[pairing, netIf] : view_.netIfs) {
      nodes.insert(pairing.first);
      picture[netIfName(pairing.first, pairing.second)] = textOf(of(netIf));
    }
    for (const DirectoryView::Instance &one : view_.instances) {
      if (!host::isZero(one.node)) nodes.insert(one.node);
      const KARSTResolverInstance instance = of(one);
      picture[instance.name] = textOf(instance, instance.state);
    }
    for (const zel_UUID &uuid : nodes) picture[nodeName(uuid)] = textOfNode(uuid);
    return picture;
  }

 private:
  static KARSTResolverNetIf of(const DirectoryView::NetIf &seen) {
    KARSTResolverNetIf netIf{};
    netIf.info = seen.info;
    netIf.health = seen.health;
    netIf.healthy = seen.health.healthFlags == 0;
    netIf.healthSubInstalled = 1;
    netIf.refCount = 2;
    return netIf;
  }

  std::string textOfNode(const zel_UUID &uuid) {
    const auto cached = cached_.find(uuid);
    KARSTResolverNode node{};
    if (cached != cached_.end()) node = *cached->second;
    node.isSelf = uuid == view_.self;
    node.rescanSeen = 0;
    const auto found = view_.nodes.find(uuid);
    node.reachable = found != view_.nodes.end();
    if (node.reachable) { /* else it is what it was */
      node.majorVersion = found->second.majorVersionNum;
      node.minorVersion = found->second.minorVersionNum;
      node.isWitness = (found->second.flags & KARST_NODE_FLAG_WITNESS) != 0;
    }
    const auto netIfs = std::count_if(view_.netIfs.begin(), view_.netIfs.end(),
                                      [&](const auto &one) { return one.first.first == uuid; });
    const auto instances = std::count_if(view_.instances.begin(), view_.instances.end(),
                                         [&](const auto &one) { return one.node == uuid; });
    node.refCount = static_cast<uint32_t>(node.reachable + netIfs + instances);
    /* A node that nothing but instances hold has a set that nobody sees. */
    if (cached != cached_.end() && (node.reachable || netIfs != 0)) {
      node.locators = locatorsOf(*cached->second);
    }
    node.locators.capacity = KARST_RESOLVER_MAX_LOCATORS;
    return textOf(node, static_cast<size_t>(netIfs), static_cast<size_t>(instances));
  }

  KARSTResolverInstance of(const DirectoryView::Instance &seen) {
    KARSTResolverInstance instance = *seen.held.instance;
    instance.refCount = 1 + instance.subscribed;
    instance.destroyed = 0;
    KARSTResolverNodeLocators answer{};
    const auto tracked = cached_.find(seen.node);
    instance.node = nullptr;
    if (tracked != cached_.end()) {
      const KARSTResolverNode &node = *tracked->second;
      instance.node = const_cast<KARSTResolverNode *>(&node);
      if (instance.useLocalLocator && seen.node == view_.self) {
        answer = versionOf(node);
        answer.count = 1;
        answer.locators[0].networkType = KARST_RESOLVER_LOCATOR_LOCAL;
      } else if (view_.nodes.count(seen.node) != 0) {
        answer = locatorsOf(node);
      }
    }
    const bool resolved = answer.count != 0;
    instance.state = resolved ? KARST_RESOLVER_STATE_RESOLVED : KARST_RESOLVER_STATE_UNRESOLVED;
    instance.locators = resolved ? answer : KARSTResolverNodeLocators{};
    return instance;
  }

  static KARSTResolverNodeLocators versionOf(const KARSTResolverNode &node) {
    KARSTResolverNodeLocators set{};
    set.nodeUUID = node.uuid;
    set.majorVersion = node.majorVersion;
    set.minorVersion = node.minorVersion;
    return set;
  }

  /* From the view's records, in the order of the node's own list. */
  KARSTResolverNodeLocators locatorsOf(const KARSTResolverNode &node) {
    KARSTResolverNodeLocators set = versionOf(node);
    set.trafficType = view_.witnessHost || node.isWitness ? 1 : 0;
    for (const KARSTResolverNetIf *netIf : netIfsOf(node, lines_)) {
      const auto found = view_.netIfs.find({node.uuid, netIf->uuid});
      if (found == view_.netIfs.end()) continue; /* reported elsewhere */
      const auto &[info, health] = found->second;
      const bool carries = (info.trafficTypeMask >> set.trafficType & 1) != 0;
      if (health.healthFlags == 0 && info.networkType == KARST_NETWORK_TYPE_IP && carries) {
        addLocators(set, info);
      }
    }
    return set;
  }

  static void addLocators(KARSTResolverNodeLocators &set, const KarstNetInterfaceEntry &info) {
    const auto add = [&](bool isIPv6, const uint8_t *address) {
      if (set.count == KARST_RESOLVER_MAX_LOCATORS) return;
      KARSTResolverNodeLocator &locator = set.locators[set.count++];
      locator.networkType = isIPv6 ? KARST_RESOLVER_LOCATOR_IPV6 : KARST_RESOLVER_LOCATOR_IPV4;
      std::memcpy(locator.address, address, isIPv6 ? 16 : 4);
    };
    for (uint32_t i = 0; i < info.numIpAddresses; i++) {
      add(info.ipAddresses[i].isIPv6, info.ipAddresses[i].address);
    }
    const uint8_t none[4] = {};
    const bool hasSingle = std::memcmp(info.ipv4Address, none, sizeof none) != 0;
    if (info.numIpAddresses == 0 && hasSingle) add(false, info.ipv4Address);
  }

  const DirectoryView &view_;
  Lines &lines_;
  std::map<zel_UUID, const KARSTResolverNode *> cached_;
};

/* The node that a client asked for or, for an object, the one that its entry leads to. */
zel_UUID nodeFor(const KARSTResolverInstance &instance, const host::Directory &directory) {
  const std::string_view nodePrefix = "node:";
  const std::string_view name = instance.name;
  if (name.starts_with(nodePrefix)) {
    return host::parseUUID(name.substr(nodePrefix.size())).value_or(zel_UUID{});
  }
  if (instance.nodeChanged) return {};
  const auto entry = directory.entry(static_cast<uint8_t>(instance.entryType), instance.objectUUID);
  if (entry) return entry->owner;
  return instance.useHintNode ? instance.hintNodeUUID : zel_UUID{};
}

}  // namespace

DirectoryView viewOf(const host::Directory &directory, const zel_UUID &self, bool witnessHost,
                     const std::vector<HeldInstance> &held) {
  DirectoryView view{self, witnessHost, {}, {}, {}};
  for (const host::Entry &entry : directory.entries(KARST_TYPE_NODE)) {
    KarstNodeEntry record{};
    if (host::decode(entry.data, &record) == ZEL_OK) view.nodes[entry.uuid] = record;
  }
  for (const host::Entry &entry : directory.entries(KARST_TYPE_NET_INTERFACE)) {
    DirectoryView::NetIf netIf{};
    if (host::decode(entry.data, &netIf.info) != ZEL_OK) continue;
    if (netIf.info.trafficTypeMask == 0) netIf.info.trafficTypeMask = ~0ull;
    const auto health = directory.entry(KARST_TYPE_HEALTH_STATUS, entry.uuid);
    if (health) {
      host::decode(health->data, &netIf.health); /* as far as it goes */
    } else {
      std::memset(&netIf.health, 0xff, sizeof netIf.health);
    }
    view.netIfs[{entry.owner, entry.uuid}] = netIf;
  }
  for (const HeldInstance &one : held) {
    view.instances.push_back({one, nodeFor(*one.instance, directory)});
  }
  return view;
}

Lines damageOf(const KARSTResolverCache *cache, const SlotSample &sample) {
  Lines lines;
  const Nodes nodes = nodesOf(cache, lines);
  const NetIfs netIfs = netIfsOf(cache, lines);
  checkSlots(cache->nodePool, KARST_RESOLVER_NODE_POOL_SIZE, KARST_RESOLVER_TAG_NODE, nodes,
             cache->freeNodes, sample, lines);
  checkSlots(cache->netIfPool, KARST_RESOLVER_NETIF_POOL_SIZE, KARST_RESOLVER_TAG_NETIF, netIfs,
             cache->freeNetIfs, sample, lines);
  if (!isTag(cache->tag, KARST_RESOLVER_TAG_CACHE)) lines.push_back("cache: its tag is wrong");
  return lines;
}

Lines differencesOf(const KARSTResolverCache *cache, const DirectoryView &view,
                    const SlotSample &sample) {
  Lines lines = damageOf(cache, sample);
  if (!lines.empty()) return lines; /* what follows relies on it */
  if (cache->dirtyNodes.next != &cache->dirtyNodes) lines.push_back("dirty nodes");

  Picture found = pictureOf(cache, view, lines);
  for (const auto &[name, text] : Expected(cache, view, lines).picture()) {
    const auto node = found.extract(name);
    const std::string is = node.empty() ? "missing" : node.mapped();
    if (is != text) lines.push_back(name + ": " + is + "; not " + text);
  }
  for (const auto &[name, text] : found) lines.push_back(name + ": should not be cached");
  return lines;
}
