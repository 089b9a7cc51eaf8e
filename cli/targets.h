/* What the resolver is asked for: nodes and objects. No lock. */
#pragma once

#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include "host/directory/directory.h"

namespace cli {

/* The command line is not one that the command understands; what() says what to write instead. */
struct UsageError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Target {
  uint8_t type = KARST_TYPE_NODE; /* of the object's entry; for a node, of the node's */
  zel_UUID uuid{};
  zel_UUID hint{}; /* of an object: the node to resolve to until its entry is found */
  bool isObject = false;
  bool operator==(const Target &) const = default;
};

/* "node" or "object 9" */
std::string kindOf(const Target &target);

/* A word of the command line that helps to name targets: the value of --hint, or a plain one. */
struct TargetWord {
  bool isHint;
  std::string text;
};

/* Reads groups of "node UUID" and "object TYPE UUID [--hint UUID]". Throws UsageError. */
std::vector<Target> parseTargets(const std::vector<TargetWord> &words);

/* Throws UsageError, saying that the UUID was wanted for `purpose`. */
zel_UUID parseUUIDFor(const std::string &purpose, const std::string &text);

/* All nodes, then all objects by type, each in ascending order of UUID. */
std::vector<Target> allTargets(const host::Directory &directory);

}  // namespace cli
