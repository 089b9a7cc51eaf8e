/* Why a target cannot be resolved, read from the directory's own content. No lock. */
#pragma once

#include <optional>
#include <string>

#include "cli/answer.h"
#include "cli/targets.h"
#include "host/directory/directory.h"

namespace cli {

struct Viewpoint {
  const host::Directory &directory;
  const Names &names;
  bool witness; /* this host is one */
};

/* What stands in the way of resolving the target, in a few words; nothing when the directory's
 * content does not show it. `boundNode`: the node that the target's instance stays with, if it has
 * one. */
std::optional<std::string> whyUnresolved(const Viewpoint &view, const Target &target,
                                         const std::optional<zel_UUID> &boundNode = {});

}  // namespace cli
