/* One instance for each of the first nodes, and how long things took. */
#pragma once

#include <algorithm>
#include <memory>
#include <vector>

#include "bench/cluster.h"

namespace growth {

inline double nanoseconds(bench::Clock::duration duration) {
  return std::chrono::duration<double, std::nano>(duration).count();
}

struct WatchedNodes {
  WatchedNodes(bench::Cluster &cluster, unsigned count) {
    for (unsigned i = 0; i < count; i++) {
      each.push_back(std::make_unique<bench::WatchedNode>(cluster, static_cast<uint8_t>(i), 1));
    }
  }
  uint64_t calls() const {
    uint64_t all = 0;
    for (const auto &node : each) all += node->calls();
    return all;
  }
  bench::Clock::time_point lastCall() const {
    bench::Clock::time_point last{};
    for (const auto &node : each) last = std::max(last, node->lastCall());
    return last;
  }
  std::vector<std::unique_ptr<bench::WatchedNode>> each;
};

}  // namespace growth
