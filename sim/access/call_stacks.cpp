/* The tree of call stacks and its texts. One OS thread, no lock. */
#include "sim/access/call_stacks.h"

#include "host/kernel/module_loader.h"

namespace sim::access {

void CallStacks::remember(uint32_t stack, const void *returnTo) {
  const auto [place, isNew] = known_.try_emplace({stack, returnTo}, nodes_.size());
  if (isNew) nodes_.push_back({.parent = stack, .returnTo = returnTo});
  nodes_[stack].lastReturn = returnTo;
  nodes_[stack].lastChild = place->second;
}

std::string CallStacks::text(const void *code, uint32_t stack) const {
  std::string lines;
  if (code) lines += "    " + host::symbolize(code) + "\n";
  for (; stack != empty; stack = nodes_[stack].parent) {
    lines += "    " + host::symbolize(nodes_[stack].returnTo) + "\n";
  }
  return lines;
}

const std::string &CallStacks::functionAt(const void *code) {
  const auto [place, isNew] = functions_.try_emplace(code);
  if (isNew) {
    const std::string symbol = host::symbolize(code);
    place->second = symbol.substr(0, symbol.find_first_of("+("));
  }
  return place->second;
}

bool CallStacks::calledFrom(const void *code, uint32_t stack, const std::string &function,
                            size_t frames) {
  for (size_t i = 0; i < frames; ++i) {
    if (functionAt(code) == function) return true;
    if (stack == empty) return false;
    code = nodes_[stack].returnTo;
    stack = nodes_[stack].parent;
  }
  return false;
}

}  // namespace sim::access
