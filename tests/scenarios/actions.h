/* What the actors of a scenario do to the directory, to the module and as its clients. No lock. */
#pragma once

#include <string>

#include "sim/explore/scenario.h"

/* X(name, text, from, a, b, c): the text takes the operation's a, b and c; chance draws them up to
 * these numbers, and `a` from that one on; scenarios.cpp knows better for some */
#define SCENARIO_ACTIONS(X)                                                    \
  X(PutNode, "put node {0}, flags {1}", 1, 4, 7, 0)                            \
  X(RemoveNode, "remove node {0}", 1, 4, 0, 0)                                 \
  X(PutNetIf, "put interface {0} of node {1}, record {2}", 1, 5, 0, 255)       \
  X(RemoveNetIf, "remove interface {0}", 1, 5, 0, 0)                           \
  X(PutHealth, "put health of interface {0}: {1}", 1, 5, 0, 0)                 \
  X(RemoveHealth, "remove health of interface {0}", 1, 5, 0, 0)                \
  X(PutObject, "put object {0}, owned by node {1}", 0, 3, 4, 0)                \
  X(RemoveObject, "remove object {0}", 0, 3, 0, 0)                             \
  X(Garble, "garble entry {0} of kind {1}", 1, 5, 2, 0)                        \
  X(Resync, "resync the directory", 0, 0, 0, 0)                                \
  X(Usable, "directory usable", 0, 0, 0, 0)                                    \
  X(Unusable, "directory unusable", 0, 0, 0, 0)                                \
  X(Interrupt, "directory unusable and at once usable", 0, 0, 0, 0)            \
  X(Flood, "put {0} times eight interfaces of nodes from {1}", 8, 47, 99, 0)   \
  X(Drain, "remove {0} times eight interfaces and their nodes", 20, 79, 99, 0) \
  X(Create, "client {0}: create for target {1}, options {2}", 0, 5, 0, 15)     \
  X(SetCallback, "client {0}: set callback, kind {1}", 0, 5, 3, 0)             \
  X(Read, "client {0}: read, kind {1}", 0, 5, 3, 0)                            \
  X(Destroy, "client {0}: destroy", 0, 5, 0, 0)                                \
  X(Load, "load the module", 0, 0, 0, 0)                                       \
  X(Unload, "unload the module", 0, 0, 0, 0)                                   \
  X(Pause, "pause {0}", 0, 3, 0, 0)                                            \
  X(Preempt, "let the world be preempted {0} times", 1, 3, 0, 0)

enum class Action : uint8_t {
#define SCENARIO_ENUMERATOR(name, ...) name,
  SCENARIO_ACTIONS(SCENARIO_ENUMERATOR)
#undef SCENARIO_ENUMERATOR
};
struct ActionShape {
  const char *text;
  uint8_t from, a, b, c;
};
inline constexpr ActionShape actionShapes[] = {
#define SCENARIO_SHAPE(name, ...) {__VA_ARGS__},
    SCENARIO_ACTIONS(SCENARIO_SHAPE)
#undef SCENARIO_SHAPE
};

inline Action actionOf(const sim::Operation &operation) {
  return static_cast<Action>(operation.kind % std::size(actionShapes));
}
std::string textOf(const sim::Operation &operation);
