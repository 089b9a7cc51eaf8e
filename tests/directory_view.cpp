/* Two pictures in the same words: of the cache, and of a sequential resolver that is told each entry
 * once; see directory_view.h. Calls nothing of the module. */
#include "tests/directory_view.h"

#include <algorithm>
#include <cstring>
#include <deque>
#include <functional>
#include <map>
#include <span>
#include <string_view>

#include "host/directory/records.h"
#include "host/kernel/text.h"
#include "host/kernel/uuid.h"
#include "tests/scenarios/model.h"

namespace {

using host::formatText;
using host::toString;
using model::Answer;
using model::Input;
using model::Inputs;
using Picture = std::map<std::string, std::string>; /* what there is, and how it is */

/* ---- Words ----------------------------------------------------------------------------------- */

/* Nobody sees the locators of a node that is not reachable. */
void addNode(Picture &picture, const zel_UUID &uuid, uint64_t references, bool reachable,
             const Answer &set) {
  picture["node " + toString(uuid)] =
      formatText("references %lu, %s", references, reachable ? set.text().c_str() : "unreachable");
}

/* Of the record the hash: enough to tell it from another. */
void addNetIf(Picture &picture, const zel_UUID &uuid, const zel_UUID &owner, uint64_t references,
              const KarstNetInterfaceEntry &info, uint32_t health) {
  const std::string_view bytes(reinterpret_cast<const char *>(&info), sizeof info);
  picture["interface " + toString(uuid) + " of " + toString(owner)] =
      formatText("references %lu, record %zx, health %u", references,
                 std::hash<std::string_view>()(bytes), health);
}

void addInstance(Picture &picture, const char *name, uint64_t references, uint32_t told,
                 const Answer &answer) {
  picture[name] = formatText("references %lu, callback was told %u, %s", references, told,
                             answer.text().c_str());
}

/* ---- The cache ------------------------------------------------------------------------------- */

template <typename Visit>
void forEachNetIf(const KARSTResolverCache *cache, Visit visit) {
  const KARSTResolverLink *head = &cache->netIfs;
  for (const KARSTResolverLink *link = head->next; link != head; link = link->next) {
    visit(*KARST_RESOLVER_CONTAINER(link, const KARSTResolverNetIf, cacheLinks));
  }
}

Picture pictureOf(const KARSTResolverCache *cache, const std::vector<HeldInstance> &held) {
  Picture picture;
  for (const KARSTResolverNode &node : std::span(cache->nodePool, KARST_RESOLVER_NODE_POOL_SIZE)) {
    if (std::memcmp(node.tag, KARST_RESOLVER_TAG_NODE, sizeof node.tag) != 0) continue;
    const Answer set = Answer::of(KARST_RESOLVER_STATE_INIT, node.locators);
    addNode(picture, node.uuid, node.refCount, node.reachable, set);
  }
  forEachNetIf(cache, [&](const KARSTResolverNetIf &netIf) {
    addNetIf(picture, netIf.uuid, netIf.node->uuid, netIf.refCount, netIf.info,
             netIf.health.healthFlags);
  });
  for (const auto &[instance, told] : held) {
    addInstance(picture, instance->name, instance->refCount, told.value_or(instance->state),
                Answer::of(instance->state, instance->locators));
  }
  return picture;
}

/* ---- The directory --------------------------------------------------------------------------- */

/* What is answered to who asks for an entry and decodes it. */
template <typename Record>
void addAnswers(Inputs &inputs, uint8_t type, const zel_UUID &uuid,
                const std::optional<host::Entry> &entry) {
  KarstEntryHeader header{};
  if (entry) header.owner = entry->owner;
  inputs.add({Input::FindWhole, type, uuid, entry ? ZEL_OK : ZEL_NOT_FOUND, header, {}, nullptr});
  if (!entry) return;
  Record record{};
  const zel_Status status = host::decode(entry->data, &record);
  const auto *bytes = reinterpret_cast<const uint8_t *>(&record);
  inputs.add({Input::Decoded, type, {}, status, {}, {bytes, bytes + sizeof record}, nullptr});
}

/* In the order in which the cache heard of them; what it does not know comes last. */
std::vector<host::Entry> netIfEntries(const KARSTResolverCache *cache,
                                      const host::Directory &directory) {
  std::map<zel_UUID, size_t> places;
  forEachNetIf(cache, [&](const auto &netIf) { places.emplace(netIf.uuid, places.size()); });
  std::vector<host::Entry> entries = directory.entries(KARST_TYPE_NET_INTERFACE);
  for (const host::Entry &entry : entries) places.emplace(entry.uuid, places.size());
  std::ranges::sort(entries, {}, [&](const host::Entry &entry) { return places[entry.uuid]; });
  return entries;
}

void tellEntries(model::Resolver &resolver, const KARSTResolverCache *cache,
                 const host::Directory &directory) {
  Inputs inputs;
  KarstEntryHeader header{};
  header.uuid = directory.self();
  inputs.add({Input::Self, 0, {}, ZEL_OK, header, {}, nullptr});
  resolver.enabled = true;
  resolver.learnSelf(inputs);
  for (const host::Entry &entry : directory.entries(KARST_TYPE_NODE)) {
    addAnswers<KarstNodeEntry>(inputs, KARST_TYPE_NODE, entry.uuid, entry);
    header.uuid = entry.uuid;
    resolver.nodeCall(header, ZEL_OK, inputs);
  }
  for (const host::Entry &entry : netIfEntries(cache, directory)) {
    addAnswers<KarstHealthStatusEntry>(inputs, KARST_TYPE_HEALTH_STATUS, entry.uuid,
                                       directory.entry(KARST_TYPE_HEALTH_STATUS, entry.uuid));
    addAnswers<KarstNetInterfaceEntry>(inputs, KARST_TYPE_NET_INTERFACE, entry.uuid, entry);
    header.uuid = entry.uuid;
    header.owner = entry.owner;
    resolver.netIfCall(header, ZEL_OK, inputs);
  }
  for (const model::NetIf *netIf : resolver.netIfs) {
    inputs.add({Input::Subscribed, KARST_TYPE_HEALTH_STATUS, netIf->uuid, ZEL_OK, {}, {}, netIf});
  }
  for (size_t i = 0; i <= resolver.dirty.size(); i++) {
    inputs.add({Input::Preemption, 0, {}, ZEL_OK, {}, {}, nullptr});
  }
  resolver.worldSection(inputs);
}

/* The node that a client asked for or, for an object, the one that its entry leads to. */
zel_UUID nodeFor(const KARSTResolverInstance &instance, const host::Directory &directory) {
  const std::string_view nodePrefix = "node:", name = instance.name;
  if (name.starts_with(nodePrefix)) {
    return host::parseUUID(name.substr(nodePrefix.size())).value_or(zel_UUID{});
  }
  if (instance.nodeChanged) return {};
  const auto entry = directory.entry(static_cast<uint8_t>(instance.entryType), instance.objectUUID);
  if (entry) return entry->owner;
  return instance.useHintNode ? instance.hintNodeUUID : zel_UUID{};
}

Picture expectedOf(const KARSTResolverCache *cache, const host::Directory &directory,
                   const std::vector<HeldInstance> &held, bool witnessHost) {
  model::Resolver resolver(witnessHost);
  tellEntries(resolver, cache, directory);
  Picture picture;
  std::deque<model::Instance> instances;
  for (const HeldInstance &one : held) {
    const KARSTResolverInstance &real = *one.instance;
    model::Instance &instance = instances.emplace_back();
    instance.local = real.useLocalLocator;
    resolver.track(instance, nodeFor(real, directory));
    Answer answer = instance.answer();
    if (answer.state == KARST_RESOLVER_STATE_RESOLVED && !instance.node->reachable) {
      answer.major = real.locators.majorVersion; /* of this host itself, as it was known last */
      answer.minor = real.locators.minorVersion;
    }
    addInstance(picture, real.name, 1u + real.subscribed, answer.state, answer);
  }
  for (const auto &[uuid, node] : resolver.nodes) {
    addNode(picture, uuid, node->references, node->reachable, node->set);
  }
  for (const model::NetIf *netIf : resolver.netIfs) {
    addNetIf(picture, netIf->uuid, netIf->node->uuid, netIf->references, netIf->info,
             netIf->health.healthFlags);
  }
  return picture;
}

}  // namespace

std::vector<std::string> differencesOf(const KARSTResolverCache *cache,
                                       const host::Directory &directory,
                                       const std::vector<HeldInstance> &held, bool witnessHost) {
  std::vector<std::string> lines;
  Picture found = pictureOf(cache, held);
  for (const auto &[name, text] : expectedOf(cache, directory, held, witnessHost)) {
    const auto node = found.extract(name);
    const std::string is = node.empty() ? "missing" : node.mapped();
    if (is != text) lines.push_back(name + ": " + is + "; not " + text);
  }
  for (const auto &[name, text] : found) lines.push_back(name + ": should not be cached");
  return lines;
}
