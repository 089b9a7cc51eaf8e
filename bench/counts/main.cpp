/* karst-counts: each hot path a fixed number of times, for callgrind to count the instructions of.
 * Run by tools/check-counts. */
#include <cstdio>
#include <exception>

#include "bench/counts/counts.h"
#include "host/kernel/log.h"

int main() {
  if (!RUNNING_ON_VALGRIND) {
    std::fprintf(stderr, "karst-counts: nobody counts; run tools/check-counts\n");
    return 2;
  }
  host::setLogThreshold(host::LogThreshold::Warning);
  try {
    bench::countMap();
    bench::countTrace();
    bench::countInstances();
    bench::countNodes();
  } catch (const std::exception &error) {
    std::fprintf(stderr, "karst-counts: %s\n", error.what());
    return 1;
  }
}
