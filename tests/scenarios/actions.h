/* What the actors of a scenario do to the directory, to the module and as its clients. No lock. */
#pragma once

#include <string>

#include "sim/explore/scenario.h"

/* X(name, text): the text takes the operation's a, b and c for the digits 1, 2 and 3 */
#define SCENARIO_ACTIONS(X)                                    \
  X(PutNode, "put node $1, flags $2")                          \
  X(RemoveNode, "remove node $1")                              \
  X(PutNetIf, "put interface $1 of node $2, record $3")        \
  X(RemoveNetIf, "remove interface $1")                        \
  X(PutHealth, "put health of interface $1: $2")               \
  X(RemoveHealth, "remove health of interface $1")             \
  X(PutObject, "put object $1, owned by node $2")              \
  X(RemoveObject, "remove object $1")                          \
  X(Garble, "garble entry $1 of kind $2")                      \
  X(Resync, "resync the directory")                            \
  X(Usable, "directory usable")                                \
  X(Unusable, "directory unusable")                            \
  X(Interrupt, "directory unusable and at once usable")        \
  X(Flood, "put $1 times eight interfaces of nodes from $2")   \
  X(Drain, "remove $1 times eight interfaces and their nodes") \
  X(Create, "client $1: create for target $2, options $3")     \
  X(SetCallback, "client $1: set callback, kind $2")           \
  X(Read, "client $1: read, kind $2")                          \
  X(Destroy, "client $1: destroy")                             \
  X(Load, "load the module")                                   \
  X(Unload, "unload the module")                               \
  X(Pause, "pause $1")                                         \
  X(Preempt, "let the world be preempted $1 times")

enum class Action : uint8_t {
#define SCENARIO_ENUMERATOR(name, text) name,
  SCENARIO_ACTIONS(SCENARIO_ENUMERATOR)
#undef SCENARIO_ENUMERATOR
};
inline constexpr size_t actionCount = 0
#define SCENARIO_COUNT(name, text) +1
    SCENARIO_ACTIONS(SCENARIO_COUNT)
#undef SCENARIO_COUNT
    ;

std::string textOf(const sim::Operation &operation);
