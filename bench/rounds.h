/* The order in which the subjects are measured. */
#pragma once

#include <string>

#include "bench/figures.h"

namespace bench {

/* Measures each subject whose name has a match of `filter` (a regular expression; "" is in all) once
 * a round. In a round, what a bar compares runs one behind the other, within a moment, in random
 * order, and so do the groups: the speed of a virtual machine changes by a third in seconds, and then
 * changes for both sides of a ratio. Shows on a terminal how far it is. False when no name matches.
 * Throws std::regex_error. Main thread. */
bool measureInRounds(size_t rounds, const std::string &filter, Figures &figures);

}  // namespace bench
