/* Call stacks of instrumented code as numbers: a tree of return addresses in which each stack is a
 * node, so that an access can name its whole stack with one number. One OS thread, no lock.
 */
#pragma once

#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

namespace sim::access {

class CallStacks {
 public:
  static constexpr uint32_t empty = 0;

  /* The stack with one more function on it, which will return to `returnTo`, and with one less. */
  uint32_t enter(uint32_t stack, const void *returnTo) {
    Node &node = nodes_[stack];
    if (node.lastReturn != returnTo) remember(stack, returnTo);
    return nodes_[stack].lastChild;
  }
  uint32_t leave(uint32_t stack) const { return nodes_[stack].parent; }

  /* "    function+0x12 in module", innermost first, a line each, beginning at `code`. */
  std::string text(const void *code, uint32_t stack) const;

  /* Is one of the innermost `frames` functions, `code` being in the first, the one of this name? */
  bool calledFrom(const void *code, uint32_t stack, const std::string &function, size_t frames);

 private:
  struct Node {
    uint32_t parent = 0;
    const void *returnTo = nullptr;
    const void *lastReturn = nullptr; /* the call made from here last, and its node */
    uint32_t lastChild = 0;
  };
  struct Call {
    uint32_t stack;
    const void *returnTo;
    bool operator==(const Call &) const = default;
  };
  struct CallHash {
    size_t operator()(const Call &call) const {
      return (reinterpret_cast<size_t>(call.returnTo) ^ size_t{call.stack} << 40) *
             0x9e3779b97f4a7c15u;
    }
  };

  void remember(uint32_t stack, const void *returnTo);
  const std::string &functionAt(const void *code);

  std::vector<Node> nodes_{1};
  std::unordered_map<Call, uint32_t, CallHash> known_;
  std::unordered_map<const void *, std::string> functions_;
};

}  // namespace sim::access
