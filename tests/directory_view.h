/* What the directory says that the module must hold, worked out from the entries alone, and where a
 * cache differs from it. No lock is taken: ask while no thread is inside the module.
 */
#pragma once

#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "host/directory/directory.h"
#include "host/kernel/uuid.h"
#include "karst_resolver/model.h"

/* An instance that a client holds, and what its callback was told last; none: it has none. */
struct HeldInstance {
  const KARSTResolverInstance *instance;
  std::optional<uint32_t> told;
};

struct DirectoryView {
  struct NetIf {
    KarstNetInterfaceEntry info;
    KarstHealthStatusEntry health; /* all ones: there is no entry */
  };
  struct Instance {
    HeldInstance held;
    zel_UUID node; /* that it tracks; zero: none */
  };
  zel_UUID self;
  bool witnessHost;
  std::map<zel_UUID, KarstNodeEntry> nodes;              /* those that are reachable */
  std::map<std::pair<zel_UUID, zel_UUID>, NetIf> netIfs; /* by owner and UUID */
  std::vector<Instance> instances;
};

/* Entries that cannot be decoded are left out. An object whose entry is gone leaves its instance
 * with its hint node, where that still counts, or with none; that an instance has been asked for a
 * second node is taken from itself. `held`: every instance that is not destroyed. */
DirectoryView viewOf(const host::Directory &directory, const zel_UUID &self, bool witnessHost,
                     const std::vector<HeldInstance> &held = {});

/* Which slots are looked into whether they are empty, if they are free: every `step`-th. */
struct SlotSample {
  size_t step = 1;
  size_t first = 0;
};

/* What is broken in the cache itself (tree, lists, slots, tags), a line each. */
std::vector<std::string> damageOf(const KARSTResolverCache *cache, const SlotSample &sample = {});

/* Damage, or else every difference of an enabled cache from the view, a line each; none: they are
 * equal. To be asked when nothing is due any more. Needs a directory that fits into the cache's slots.
 * A new version or witness flag of a node alone changes no locators: have each such node marked dirty
 * before. */
std::vector<std::string> differencesOf(const KARSTResolverCache *cache, const DirectoryView &view,
                                       const SlotSample &sample = {});
