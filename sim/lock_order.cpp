/* The graph of lock classes: edges as a matrix, a search for a way back before each new one. One OS
 * thread, no lock.
 */
#include "sim/lock_order.h"

#include <algorithm>
#include <array>
#include <bitset>
#include <map>
#include <vector>

#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "sim/access/recorder.h"
#include "sim/locks.h"

namespace sim {

namespace {

constexpr size_t mostClasses = 256;

struct Graph {
  std::vector<std::string> names{"nothing"};
  std::array<std::bitset<mostClasses>, mostClasses> edges{};
  std::map<std::pair<uint8_t, uint8_t>, std::string> firstSeen;
};

Graph &graph() {
  static Graph whole;
  return whole;
}

/* The classes from `from` to `to` along edges, both included; empty where there is no way. */
std::vector<uint8_t> wayBetween(uint8_t from, uint8_t to) {
  std::vector<uint8_t> cameFrom(mostClasses, 0);
  std::vector<uint8_t> ahead{from};
  for (size_t i = 0; i < ahead.size() && ahead[i] != to; ++i) {
    for (size_t next = 1; next < graph().names.size(); ++next) {
      if (!graph().edges[ahead[i]][next] || cameFrom[next] || next == from) continue;
      cameFrom[next] = ahead[i];
      ahead.push_back(static_cast<uint8_t>(next));
    }
  }
  if (from != to && !cameFrom[to]) return {};
  std::vector<uint8_t> way{to};
  while (way.back() != from) way.push_back(cameFrom[way.back()]);
  std::reverse(way.begin(), way.end());
  return way;
}

std::string sighting(const Fiber &fiber, uint8_t held, uint8_t wanted) {
  const access::Recorder *recorder = access::watching;
  return host::formatText("  %s inside \"%s\", by %s\n", LockOrder::name(wanted).c_str(),
                          LockOrder::name(held).c_str(), fiber.name().c_str()) +
         (recorder ? recorder->callStack() : std::string());
}

void addEdge(const Fiber &fiber, uint8_t held, uint8_t wanted) {
  Graph &whole = graph();
  if (whole.edges[held][wanted]) return;
  const std::vector<uint8_t> back = wayBetween(wanted, held);
  std::string seen = sighting(fiber, held, wanted);
  if (!back.empty()) {
    std::string text = "locks are taken in a circle:\n" + seen;
    for (size_t i = 0; i + 1 < back.size(); ++i) {
      text += whole.firstSeen[{back[i], back[i + 1]}];
    }
    host::panic("%s", text.c_str());
  }
  whole.edges[held].set(wanted);
  whole.firstSeen[{held, wanted}] = std::move(seen);
}

}  // namespace

uint8_t LockOrder::classOf(std::string_view name) {
  std::vector<std::string> &names = graph().names;
  const auto found = std::find(names.begin() + 1, names.end(), name);
  if (found != names.end()) return static_cast<uint8_t>(found - names.begin());
  if (names.size() == mostClasses)
    host::panic("\"%s\": too many names of locks", std::string(name).c_str());
  names.emplace_back(name);
  return static_cast<uint8_t>(names.size() - 1);
}

std::string LockOrder::name(uint32_t lockClass) {
  return graph().names.at(lockClass);
}

void LockOrder::requireOrder(const Fiber &fiber, uint8_t lockClass) {
  for (uint32_t i = 0; i < fiber.heldCount; ++i) {
    addEdge(fiber, fiber.held[i]->lockClass, lockClass);
  }
  for (uint32_t i = 0; i < fiber.insideCount; ++i) addEdge(fiber, fiber.inside[i], lockClass);
}

Inside::Inside(Fiber &fiber, std::string_view what) : fiber_(fiber) {
  if (fiber.insideCount == fiber.inside.size()) {
    host::panic("%s is inside too much to enter %s", fiber.name().c_str(),
                std::string(what).c_str());
  }
  const uint8_t entered = LockOrder::classOf(what);
  LockOrder::requireOrder(fiber, entered);
  fiber.inside[fiber.insideCount++] = entered;
}

Inside::~Inside() {
  --fiber_.insideCount;
}

std::string insideWorld(const char *name) {
  return std::string("the body of world ") + name;
}

}  // namespace sim
