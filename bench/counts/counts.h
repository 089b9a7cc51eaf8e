/* What karst-counts counts, a file each, and how: callgrind counts, and is told before and after a
 * piece of work to write down by its name what was executed between. tools/check-counts reads it. */
#pragma once

#include <valgrind/callgrind.h>

#include <string>

namespace bench {

/* Counts the second of two runs of `work`, which does `operations` of them: in the first one, what
 * is bound late is bound and what grows on demand grows. `undo`, after each, is not counted. */
template <typename Work, typename Undo>
void count(const std::string &name, size_t operations, const Work &work, const Undo &undo) {
  const std::string label = name + ";" + std::to_string(operations);
  work();
  undo();
  CALLGRIND_ZERO_STATS;
  work();
  CALLGRIND_DUMP_STATS_AT(label.c_str());
  undo();
}

template <typename Work>
void count(const std::string &name, size_t operations, const Work &work) {
  count(name, operations, work, [] {});
}

inline std::string sized(const std::string &work, const std::string &unit, size_t size) {
  return work + ", " + unit + " = " + std::to_string(size);
}

void countMap();
void countTrace();
void countInstances();
void countNodes();

}  // namespace bench
