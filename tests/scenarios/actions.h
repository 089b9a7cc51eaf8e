/* What the actors of a scenario do to the directory, to the module and as its clients. No lock. */
#pragma once

#include <string>

#include "sim/explore/scenario.h"

/* X(name, text): the text takes the operation's a, b and c */
#define SCENARIO_ACTIONS(X)                                     \
  X(PutNode, "put node {0}, flags {1}")                         \
  X(RemoveNode, "remove node {0}")                              \
  X(PutNetIf, "put interface {0} of node {1}, record {2}")      \
  X(RemoveNetIf, "remove interface {0}")                        \
  X(PutHealth, "put health of interface {0}: {1}")              \
  X(RemoveHealth, "remove health of interface {0}")             \
  X(PutObject, "put object {0}, owned by node {1}")             \
  X(RemoveObject, "remove object {0}")                          \
  X(Garble, "garble entry {0} of kind {1}")                     \
  X(Resync, "resync the directory")                             \
  X(Usable, "directory usable")                                 \
  X(Unusable, "directory unusable")                             \
  X(Interrupt, "directory unusable and at once usable")         \
  X(Flood, "put {0} times eight interfaces of nodes from {1}")  \
  X(Drain, "remove {0} times eight interfaces and their nodes") \
  X(Create, "client {0}: create for target {1}, options {2}")   \
  X(SetCallback, "client {0}: set callback, kind {1}")          \
  X(Read, "client {0}: read, kind {1}")                         \
  X(Destroy, "client {0}: destroy")                             \
  X(Load, "load the module")                                    \
  X(Unload, "unload the module")                                \
  X(Pause, "pause {0}")                                         \
  X(Preempt, "let the world be preempted {0} times")

enum class Action : uint8_t {
#define SCENARIO_ENUMERATOR(name, text) name,
  SCENARIO_ACTIONS(SCENARIO_ENUMERATOR)
#undef SCENARIO_ENUMERATOR
};
inline constexpr const char *actionTexts[] = {
#define SCENARIO_TEXT(name, text) text,
    SCENARIO_ACTIONS(SCENARIO_TEXT)
#undef SCENARIO_TEXT
};

inline Action actionOf(const sim::Operation &operation) {
  return static_cast<Action>(operation.kind % std::size(actionTexts));
}
std::string textOf(const sim::Operation &operation);
