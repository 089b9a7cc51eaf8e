/* Aligned text: a table of cells whose last column flows. No lock. */
#pragma once

#include <string>
#include <vector>

#include "cli/answer.h"

namespace cli {

/* Characters that a table spans; what flows continues below, under its own column. A word is never
 * broken. */
inline constexpr size_t kTableWidth = 150;

/* The answers as a table with a heading. `colour`: with the terminal's. */
std::string toTable(const std::vector<Answer> &answers, const Names &names, bool colour);

/* "resolved" or "unresolved", in its colour if any. */
std::string stateText(bool resolved, bool colour);

/* "alder 7.2, traffic type 0: 192.0.2.1 2001:db8::1", or the reason. */
std::string detailText(const Answer &answer, const Names &names);

/* A name as it may be shown on a terminal: without control characters. */
std::string printable(const std::string &name);

}  // namespace cli
