/* The view and the comparison; see directory_view.h. Calls nothing of the module, takes no lock. */
#include "tests/directory_view.h"

#include <algorithm>
#include <cstring>
#include <set>

#include "host/directory/records.h"
#include "host/kernel/text.h"

namespace {

using Lines = std::vector<std::string>;
using host::formatText;

/* ---- Structure ------------------------------------------------------------------------------- */

uint64_t wordOf(const char *tag) {
  uint64_t word;
  std::memcpy(&word, tag, sizeof word);
  return word;
}

bool isTag(const char *tag, const char *text) {
  return wordOf(tag) == wordOf(text);
}

bool isFreeTag(const char *tag, const char *text) {
  return wordOf(tag) == ~wordOf(text);
}

/* The structures on a list, whose links must lead the same way forth and back. `owner`: of the
 * list, if it is one of several. */
template <typename Element>
std::vector<const Element *> elementsOf(const KARSTResolverLink &head, size_t offset,
                                        const char *what, Lines &lines,
                                        const zel_UUID *owner = nullptr) {
  const auto damaged = [&](const std::string &how) {
    lines.push_back(what + (owner != nullptr ? " of node " + host::toString(*owner) : "") + how);
  };
  std::vector<const Element *> elements;
  const KARSTResolverLink *previous = &head;
  for (const KARSTResolverLink *link = head.next; link != &head; link = link->next) {
    if (link == nullptr || link->previous != previous || elements.size() == 100'000) {
      damaged(": broken at " + std::to_string(elements.size()));
      return elements;
    }
    elements.push_back(
        reinterpret_cast<const Element *>(reinterpret_cast<const uint8_t *>(link) - offset));
    previous = link;
  }
  if (head.previous != previous) damaged(": its last element is another one");
  return elements;
}

std::vector<const KARSTResolverNetIf *> netIfsOf(const KARSTResolverNode *node, Lines &lines) {
  return elementsOf<KARSTResolverNetIf>(node->netIfList, offsetof(KARSTResolverNetIf, nodeLinks),
                                        "interfaces", lines, &node->uuid);
}

std::vector<const KARSTResolverInstance *> instancesOf(const KARSTResolverNode *node,
                                                       Lines &lines) {
  return elementsOf<KARSTResolverInstance>(node->instanceList,
                                           offsetof(KARSTResolverInstance, nodeLinks), "instances",
                                           lines, &node->uuid);
}

/* The node tree: colours, heights, parents, order, number. */
class TreeWalk {
 public:
  TreeWalk(const KARSTRBTree *tree, Lines &lines) : tree_(tree), lines_(lines) {
    const KARSTRBTreeData &data = *tree->data;
    require(!isRed(data.nil) && !isRed(data.root), "root and nil are black");
    blackHeight(data.root, data.nil);
    require(nodes.size() == data.count, "its count is the number of its nodes");
    for (size_t i = 1; i < nodes.size(); i++) {
      require(words(nodes[i - 1]) < words(nodes[i]), "the keys ascend");
    }
  }
  std::vector<const KARSTResolverNode *> nodes; /* in order */

 private:
  const KARSTRBTreeNode *at(uint64_t link) const {
    return reinterpret_cast<const KARSTRBTreeNode *>(tree_->base + link);
  }
  bool isRed(uint64_t link) const { return (at(link)->word & KARSTRBTREE_NODE_RED) != 0; }
  static std::pair<uint64_t, uint64_t> words(const KARSTResolverNode *node) {
    uint64_t words[2];
    std::memcpy(words, node->uuid.bytes, sizeof words);
    return {words[0], words[1]};
  }
  void require(bool condition, const char *what) {
    if (!condition) lines_.push_back(std::string("node tree: not so: ") + what);
  }

  int blackHeight(uint64_t link, uint64_t parent) {
    if (link == tree_->data->nil || nodes.size() > KARST_RESOLVER_NODE_POOL_SIZE) return 0;
    const KARSTRBTreeNode *element = at(link);
    const auto *node = reinterpret_cast<const KARSTResolverNode *>(
        reinterpret_cast<const uint8_t *>(element) - offsetof(KARSTResolverNode, treeElem));
    require(element->parent == parent, "a child knows its parent");
    require(!isRed(link) || (!isRed(element->left) && !isRed(element->right)),
            "children of a red node are black");
    const auto *key = reinterpret_cast<const KARSTRBTreeKey *>(tree_->base + element->key);
    require(key == &node->key && key->kind == KARSTRBTREE_KEY_UUID && key->uuid == &node->uuid,
            "a node's key is its own");
    const int left = blackHeight(element->left, link);
    nodes.push_back(node);
    const int right = blackHeight(element->right, link);
    require(left == right, "every path is equally black");
    return left + (isRed(link) ? 0 : 1);
  }

  const KARSTRBTree *tree_;
  Lines &lines_;
};

/* All bytes but the tag and the place on the free list. */
template <typename Slot>
bool isEmpty(const Slot &slot) {
  static constexpr Slot empty{};
  constexpr size_t links = offsetof(Slot, freeLinks);
  static_assert(offsetof(Slot, tag) == 0 && links >= sizeof empty.tag);
  const auto same = [&](size_t from, size_t to) {
    return std::memcmp(reinterpret_cast<const uint8_t *>(&slot) + from,
                       reinterpret_cast<const uint8_t *>(&empty) + from, to - from) == 0;
  };
  return same(sizeof empty.tag, links) && same(links + sizeof empty.freeLinks, sizeof empty);
}

/* Every slot is in use and known, or free, listed and empty. */
template <typename Slot>
void checkSlots(const Slot *pool, uint32_t size, const char *tag, std::set<const Slot *> used,
                const KARSTResolverLink &freeList, Lines &lines) {
  const std::string what = std::string(tag, 8) + " slots";
  const std::string free = "free " + what;
  size_t freeSlots = 0;
  for (const Slot *slot :
       elementsOf<Slot>(freeList, offsetof(Slot, freeLinks), free.c_str(), lines)) {
    const bool inPool = slot >= pool && slot < pool + size;
    if (!inPool || !isFreeTag(slot->tag, tag) || !isEmpty(*slot)) {
      lines.push_back(formatText("%s: %zu is not empty", free.c_str(), freeSlots));
    }
    ++freeSlots;
  }
  size_t tagged = 0;
  for (uint32_t i = 0; i < size; i++) {
    const bool inUse = isTag(pool[i].tag, tag);
    tagged += inUse;
    if (inUse ? used.count(&pool[i]) == 0 : !isFreeTag(pool[i].tag, tag)) {
      lines.push_back(formatText("%s: the tag of %u is wrong", what.c_str(), i));
    }
  }
  if (tagged != used.size() || freeSlots + used.size() != size) {
    lines.push_back(formatText("%s: %zu free, %zu in use, %zu by their tags", what.c_str(),
                               freeSlots, used.size(), tagged));
  }
}

/* Interfaces that are on no list any more, and wait for the last call of their subscription. */
std::vector<const KARSTResolverNetIf *> destroyedNetIfs(const KARSTResolverCache *cache) {
  std::vector<const KARSTResolverNetIf *> found;
  for (uint32_t i = 0; i < KARST_RESOLVER_NETIF_POOL_SIZE; i++) {
    const KARSTResolverNetIf &slot = cache->netIfPool[i];
    if (isTag(slot.tag, KARST_RESOLVER_TAG_NETIF) && slot.node == nullptr) found.push_back(&slot);
  }
  return found;
}

std::vector<const KARSTResolverNetIf *> liveNetIfs(const KARSTResolverCache *cache, Lines &lines) {
  return elementsOf<KARSTResolverNetIf>(cache->netIfs, offsetof(KARSTResolverNetIf, cacheLinks),
                                        "interfaces", lines);
}

std::vector<const KARSTResolverNode *> dirtyNodes(const KARSTResolverCache *cache, Lines &lines) {
  return elementsOf<KARSTResolverNode>(cache->dirtyNodes, offsetof(KARSTResolverNode, dirtyLinks),
                                       "dirty nodes", lines);
}

void checkReferences(const std::vector<const KARSTResolverNode *> &nodes,
                     const std::set<const KARSTResolverNetIf *> &live, Lines &lines) {
  size_t attached = 0;
  for (const KARSTResolverNode *node : nodes) {
    const auto netIfs = netIfsOf(node, lines);
    const auto instances = instancesOf(node, lines);
    const size_t references = node->reachable + netIfs.size() + instances.size();
    if (node->refCount != references || references == 0) {
      lines.push_back(formatText("node %s: %u references, not %zu",
                                 host::toString(node->uuid).c_str(), node->refCount, references));
    }
    for (const KARSTResolverNetIf *netIf : netIfs) {
      attached += live.count(netIf);
      if (netIf->node != node) lines.push_back("an interface is on another node's list");
    }
    for (const KARSTResolverInstance *instance : instances) {
      if (instance->node != node || !isTag(instance->tag, KARST_RESOLVER_TAG_INSTANCE)) {
        lines.push_back("an instance is on another node's list, or is none");
      }
    }
  }
  if (attached != live.size()) lines.push_back("an interface is on no node's list");
}

/* ---- Locators -------------------------------------------------------------------------------- */

KARSTResolverNodeLocator locatorOf(bool isIPv6, const uint8_t *address) {
  KARSTResolverNodeLocator locator{};
  locator.networkType = isIPv6 ? KARST_RESOLVER_LOCATOR_IPV6 : KARST_RESOLVER_LOCATOR_IPV4;
  std::memcpy(locator.address, address, isIPv6 ? 16 : 4);
  return locator;
}

std::vector<KARSTResolverNodeLocator> locatorsOf(const KarstNetInterfaceEntry &info) {
  std::vector<KARSTResolverNodeLocator> found;
  for (uint32_t i = 0; i < info.numIpAddresses; i++) {
    found.push_back(locatorOf(info.ipAddresses[i].isIPv6, info.ipAddresses[i].address));
  }
  const uint8_t none[4] = {};
  if (found.empty() && std::memcmp(info.ipv4Address, none, sizeof none) != 0) {
    found.push_back(locatorOf(false, info.ipv4Address));
  }
  return found;
}

/* What a client may rely on: of an IPv4 address four bytes count. */
bool sameAnswer(const KARSTResolverNodeLocators &a, const KARSTResolverNodeLocators &b) {
  if (a.nodeUUID != b.nodeUUID || a.majorVersion != b.majorVersion ||
      a.minorVersion != b.minorVersion || a.trafficType != b.trafficType || a.count != b.count) {
    return false;
  }
  return std::equal(a.locators, a.locators + a.count, b.locators, [](const auto &x, const auto &y) {
    const size_t length = x.networkType == KARST_RESOLVER_LOCATOR_IPV6   ? 16
                          : x.networkType == KARST_RESOLVER_LOCATOR_IPV4 ? 4
                                                                         : 0;
    return x.networkType == y.networkType && std::memcmp(x.address, y.address, length) == 0;
  });
}

/* "version 3.1, traffic 0, 1:0a010203...", for reports. */
std::string textOf(const KARSTResolverNodeLocators &set) {
  std::string text = formatText("version %u.%u, traffic %d,", set.majorVersion, set.minorVersion,
                                static_cast<int>(set.trafficType));
  for (uint16_t i = 0; i < std::min<uint16_t>(set.count, KARST_RESOLVER_MAX_LOCATORS); i++) {
    text += formatText(" %u:", set.locators[i].networkType);
    for (const uint8_t byte : set.locators[i].address) text += formatText("%02x", byte);
  }
  return text;
}

/* ---- Comparison ------------------------------------------------------------------------------ */

class Comparison {
 public:
  Comparison(const KARSTResolverCache *cache, const DirectoryView &view)
      : cache_(cache), view_(view), nodes_(TreeWalk(cache->nodeTree, lines).nodes) {}

  void compare() {
    compareCache();
    compareNodes();
    compareNetIfs();
    for (const DirectoryView::Instance &instance : view_.instances) compareInstance(instance);
  }
  Lines lines;

 private:
  void expect(bool condition, const std::string &subject, const char *what) {
    if (!condition) lines.push_back(subject + ": " + what);
  }
  void expectNumber(uint64_t found, uint64_t expected, const std::string &subject,
                    const char *what) {
    if (found == expected) return;
    lines.push_back(formatText("%s: %s %llu, not %llu", subject.c_str(), what,
                               static_cast<unsigned long long>(found),
                               static_cast<unsigned long long>(expected)));
  }

  void expectAnswer(const KARSTResolverNodeLocators &found,
                    const KARSTResolverNodeLocators &expected, const std::string &subject) {
    if (sameAnswer(found, expected)) return;
    lines.push_back(subject + ": " + textOf(found) + "; not " + textOf(expected));
  }

  void compareCache() {
    const auto netIfs = liveNetIfs(cache_, lines);
    const auto installed = std::count_if(netIfs.begin(), netIfs.end(),
                                         [](auto *netIf) { return netIf->healthSubInstalled; });
    expectNumber(cache_->enabled, view_.enabled, "cache", "enabled");
    expectNumber(
        cache_->refCount,
        (view_.enabled ? 2 : 0) + static_cast<uint64_t>(installed) + view_.instances.size(),
        "cache", "references");
    expectNumber(destroyedNetIfs(cache_).size(), 0, "cache",
                 "interfaces that wait for a last call");
    if (!view_.enabled) return;
    expect(cache_->selfUUID == view_.self, "cache", "another self");
    expectNumber(dirtyNodes(cache_, lines).size(), 0, "cache", "dirty nodes");
  }

  void compareNodes() {
    std::set<zel_UUID> expected;
    for (const DirectoryView::Instance &instance : view_.instances) {
      const KARSTResolverNode *node = instance.held.instance->node;
      if (view_.enabled) {
        expected.insert(instance.node);
      } else if (node != nullptr) { /* as it was left */
        expected.insert(node->uuid);
      }
    }
    expected.erase(zel_UUID{});
    if (view_.enabled) {
      for (const auto &[uuid, record] : view_.nodes) expected.insert(uuid);
      for (const auto &[pairing, netIf] : view_.netIfs) expected.insert(pairing.first);
    }
    for (const KARSTResolverNode *node : nodes_) {
      const std::string name = "node " + host::toString(node->uuid);
      expect(expected.erase(node->uuid) == 1, name, "should not be cached");
      compareNode(node, name);
    }
    for (const zel_UUID &uuid : expected) expect(false, "node " + host::toString(uuid), "missing");
  }

  void compareNode(const KARSTResolverNode *node, const std::string &name) {
    const auto found = view_.nodes.find(node->uuid);
    const bool reachable = view_.enabled && found != view_.nodes.end();
    expectNumber(node->reachable, reachable, name, "reachable");
    expectNumber(node->rescanSeen, 0, name, "seen by a rescan");
    if (!view_.enabled) return;
    expectNumber(node->isSelf, node->uuid == view_.self, name, "is self");
    if (reachable) {
      const KarstNodeEntry &record = found->second;
      expectNumber(node->majorVersion, record.majorVersionNum, name, "major version");
      expectNumber(node->minorVersion, record.minorVersionNum, name, "minor version");
      expectNumber(node->isWitness, (record.flags & KARST_NODE_FLAG_WITNESS) != 0, name, "witness");
    }
    /* A node that nothing but instances hold has a set that nobody sees. */
    const bool seen = reachable || !netIfsOf(node, lines).empty();
    if (seen) expectAnswer(node->locators, locatorsOfNode(node), name);
    expectNumber(node->locators.capacity, KARST_RESOLVER_MAX_LOCATORS, name, "capacity");
  }

  /* From the view's records, in the order of the node's own list. */
  KARSTResolverNodeLocators locatorsOfNode(const KARSTResolverNode *node) {
    KARSTResolverNodeLocators set{};
    set.nodeUUID = node->uuid;
    set.majorVersion = node->majorVersion;
    set.minorVersion = node->minorVersion;
    set.trafficType = view_.witnessHost || node->isWitness ? 1 : 0;
    for (const KARSTResolverNetIf *netIf : netIfsOf(node, lines)) {
      const auto found = view_.netIfs.find({node->uuid, netIf->uuid});
      if (found == view_.netIfs.end()) continue; /* reported elsewhere */
      const KarstNetInterfaceEntry &info = found->second.info;
      if (found->second.health.healthFlags != 0 || info.networkType != KARST_NETWORK_TYPE_IP ||
          (info.trafficTypeMask >> set.trafficType & 1) == 0) {
        continue;
      }
      for (const KARSTResolverNodeLocator &locator : locatorsOf(info)) {
        if (set.count < KARST_RESOLVER_MAX_LOCATORS) set.locators[set.count++] = locator;
      }
    }
    return set;
  }

  void compareNetIfs() {
    std::map<std::pair<zel_UUID, zel_UUID>, DirectoryView::NetIf> expected;
    if (view_.enabled) expected = view_.netIfs;
    for (const KARSTResolverNetIf *netIf : liveNetIfs(cache_, lines)) {
      const std::string name = "interface " + host::toString(netIf->uuid);
      const auto found = expected.extract({netIf->node->uuid, netIf->uuid});
      if (found.empty()) {
        expect(false, name, "should not be cached");
        continue;
      }
      const DirectoryView::NetIf &seen = found.mapped();
      expect(std::memcmp(&netIf->info, &seen.info, sizeof seen.info) == 0, name, "other record");
      expect(std::memcmp(&netIf->health, &seen.health, sizeof seen.health) == 0, name,
             "other health record");
      expectNumber(netIf->healthy, seen.health.healthFlags == 0, name, "healthy");
      expectNumber(netIf->healthSubInstalled, seen.subscribed, name, "subscribed to its health");
      expectNumber(netIf->rescanSeen, 0, name, "seen by a rescan");
    }
    for (const auto &[pairing, netIf] : expected) {
      expect(false, "interface " + host::toString(pairing.second), "missing");
    }
  }

  void compareInstance(const DirectoryView::Instance &seen) {
    const KARSTResolverInstance &instance = *seen.held.instance;
    const std::string name = instance.name;
    expectNumber(instance.destroyed, 0, name, "destroyed");
    expectNumber(instance.refCount, 1 + instance.subscribed, name, "references");
    if (seen.held.told) expectNumber(*seen.held.told, instance.state, name, "callback was told");
    if (!view_.enabled) return; /* nobody has refreshed it since */

    const KARSTResolverNode *node = instance.node;
    expect((node != nullptr ? node->uuid : zel_UUID{}) == seen.node, name, "another node");
    KARSTResolverNodeLocators answer{};
    if (node != nullptr && instance.useLocalLocator && seen.node == view_.self) {
      answer.nodeUUID = seen.node;
      answer.majorVersion = node->majorVersion;
      answer.minorVersion = node->minorVersion;
      answer.count = 1;
      answer.locators[0].networkType = KARST_RESOLVER_LOCATOR_LOCAL;
    } else if (node != nullptr && view_.nodes.count(seen.node) != 0) {
      const KARSTResolverNodeLocators set = locatorsOfNode(node);
      if (set.count != 0) answer = set;
    }
    expectNumber(
        instance.state,
        answer.count != 0 ? KARST_RESOLVER_STATE_RESOLVED : KARST_RESOLVER_STATE_UNRESOLVED, name,
        "state");
    expectAnswer(instance.locators, answer, name);
  }

  const KARSTResolverCache *cache_;
  const DirectoryView &view_;
  const std::vector<const KARSTResolverNode *> nodes_; /* after `lines`, which it may add to */
};

/* The node that a client asked for or, for an object, the one that its entry leads to. */
zel_UUID nodeFor(const KARSTResolverInstance &instance, const host::Directory &directory) {
  const std::string nodePrefix = "node:";
  const std::string name = instance.name;
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
  DirectoryView view;
  view.self = self;
  view.witnessHost = witnessHost;
  for (const host::Entry &entry : directory.entries(KARST_TYPE_NODE)) {
    KarstNodeEntry record{};
    if (host::decode(entry.data, &record) == ZEL_OK) view.nodes[entry.uuid] = record;
  }
  for (const host::Entry &entry : directory.entries(KARST_TYPE_NET_INTERFACE)) {
    DirectoryView::NetIf netIf{};
    if (host::decode(entry.data, &netIf.info) != ZEL_OK) continue;
    if (netIf.info.trafficTypeMask == 0) netIf.info.trafficTypeMask = ~0ull;
    std::memset(&netIf.health, 0xff, sizeof netIf.health);
    const auto health = directory.entry(KARST_TYPE_HEALTH_STATUS, entry.uuid);
    if (health) {
      netIf.health = {};
      host::decode(health->data, &netIf.health); /* as far as it goes */
    }
    view.netIfs[{entry.owner, entry.uuid}] = netIf;
  }
  for (const HeldInstance &one : held) {
    view.instances.push_back({one, nodeFor(*one.instance, directory)});
  }
  return view;
}

Lines damageOf(const KARSTResolverCache *cache) {
  Lines lines;
  if (!isTag(cache->tag, KARST_RESOLVER_TAG_CACHE)) lines.push_back("cache: its tag is wrong");
  const auto nodes = TreeWalk(cache->nodeTree, lines).nodes;
  checkSlots(cache->nodePool, KARST_RESOLVER_NODE_POOL_SIZE, KARST_RESOLVER_TAG_NODE,
             {nodes.begin(), nodes.end()}, cache->freeNodes, lines);

  const auto live = liveNetIfs(cache, lines);
  std::set<const KARSTResolverNetIf *> used(live.begin(), live.end());
  checkReferences(nodes, used, lines);
  for (const KARSTResolverNetIf *netIf : live) {
    if (netIf->node == nullptr || netIf->refCount != 1u + netIf->healthSubInstalled) {
      lines.push_back("interface " + host::toString(netIf->uuid) + ": references, or no node");
    }
  }
  for (const KARSTResolverNetIf *netIf : destroyedNetIfs(cache)) {
    used.insert(netIf);
    if (netIf->refCount != 1 || netIf->healthSubInstalled) {
      lines.push_back("interface " + host::toString(netIf->uuid) + ": destroyed, and held");
    }
  }
  checkSlots(cache->netIfPool, KARST_RESOLVER_NETIF_POOL_SIZE, KARST_RESOLVER_TAG_NETIF, used,
             cache->freeNetIfs, lines);

  const auto dirty = dirtyNodes(cache, lines);
  for (const KARSTResolverNode *node : nodes) {
    const bool queued = node->dirtyLinks.next != nullptr || node->dirtyLinks.previous != nullptr;
    const auto times = std::count(dirty.begin(), dirty.end(), node);
    if (times != (queued ? 1 : 0)) {
      lines.push_back("node " + host::toString(node->uuid) + ": queued otherwise than it says");
    }
  }
  if (std::any_of(dirty.begin(), dirty.end(), [&](const KARSTResolverNode *node) {
        return std::count(nodes.begin(), nodes.end(), node) == 0;
      })) {
    lines.push_back("dirty nodes: one is not in the tree");
  }
  return lines;
}

Lines differencesOf(const KARSTResolverCache *cache, const DirectoryView &view) {
  const Lines damage = damageOf(cache);
  if (!damage.empty()) return damage;
  Comparison comparison(cache, view);
  comparison.compare();
  return comparison.lines;
}
