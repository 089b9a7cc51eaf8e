/* karst-sim: the explorer over this project's scenarios. No lock. */
#include "sim/explore/explore.h"
#include "tests/scenarios/scenarios.h"

int main(int argc, char **argv) {
  return sim::explore(argc, argv, scenarios(),
                      {.program = "karst-sim",
                       .watched = "karst_resolver_watched.so",
                       .plain = "karst_resolver.so"});
}
