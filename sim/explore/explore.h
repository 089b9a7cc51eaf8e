/* The command that searches scenarios for faults. One thread, and children that play. */
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "sim/explore/scenario.h"

namespace sim {

struct ExploreDefaults {
  std::string program; /* its name, for what is printed */
  std::string watched; /* module files beside the program: the one whose accesses are seen, */
  std::string plain;   /* and the ordinary one, which stands in where there is no other */
};

/* The whole command: reads its options, searches, shortens and reports. Gives the exit status: 0
 * nothing was found, 1 a failure was, 2 the command line is wrong, 130 interrupted before the first
 * run had ended. Standard output has the results, standard error the progress. */
int explore(int argc, char **argv, const std::vector<std::unique_ptr<Scenario>> &scenarios,
            const ExploreDefaults &defaults);

}  // namespace sim
