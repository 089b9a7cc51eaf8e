/* karst resolve */
#pragma once

#include <vector>

#include "cli/output.h"
#include "cli/session.h"

namespace cli {

enum class Format { Text, Json };

/* What to ask for; no targets stand for all that the directory has. */
struct Question {
  std::vector<Target> targets;
  bool all = false;
};

/* Exit statuses of the command. */
inline constexpr int kResolved = 0;
inline constexpr int kNotResolved = 1;
inline constexpr int kBadInput = 2;

/* Prints the answers. kResolved when every target is. */
int resolve(Session &session, const Question &question, Format format, Output &output);

}  // namespace cli
