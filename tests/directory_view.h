/* Where a module at rest differs from what the directory's entries alone say that it must hold. No
 * lock is taken: ask while no thread is inside the module.
 */
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "host/directory/directory.h"
#include "karst_resolver/model.h"

/* An instance that a client holds, and what its callback was told last; none: it has none. */
struct HeldInstance {
  const KARSTResolverInstance *instance;
  std::optional<uint32_t> told;
};

/* A line for each node, interface and instance that is missing, too much, or not as the entries say;
 * none: the cache holds what the directory says, and every instance answers so. To be asked when
 * nothing is due any more, of an enabled cache whose slots suffice. `held`: every instance that is
 * not destroyed.
 *
 * Entries that cannot be decoded count for nothing, of a health record what could be read. An object
 * whose entry is gone leaves its instance with its hint node, where that still counts, or with none;
 * that an instance has been asked for a second node is taken from itself. A new version or witness
 * flag of a node alone changes no locators: have each such node marked dirty before. */
std::vector<std::string> differencesOf(const KARSTResolverCache *cache,
                                       const host::Directory &directory,
                                       const std::vector<HeldInstance> &held,
                                       bool witnessHost = false);
