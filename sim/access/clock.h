/* Vector clocks (Fidge 1988, Mattern 1989): what of every other fiber's past somebody knows. One OS
 * thread, no lock.
 */
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace sim::access {

class Clock {
 public:
  uint32_t at(size_t slot) const { return slot < times_.size() ? times_[slot] : 0; }

  void set(size_t slot, uint32_t time) {
    if (slot >= times_.size()) times_.resize(slot + 1);
    times_[slot] = time;
  }

  void join(const Clock &other) {
    if (times_.size() < other.times_.size()) times_.resize(other.times_.size());
    for (size_t i = 0; i < other.times_.size(); ++i) {
      times_[i] = std::max(times_[i], other.times_[i]);
    }
  }

  void clear() { times_.clear(); }

 private:
  std::vector<uint32_t> times_; /* by slot; those beyond its end are zero */
};

}  // namespace sim::access
