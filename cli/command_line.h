/* The command line: what was asked for, and the help that teaches to ask. No lock. */
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "cli/resolve.h"
#include "cli/session.h"
#include "host/kernel/log.h"

namespace cli {

enum class Command { Resolve, Watch, Modinfo };

struct CommandLine {
  Command command = Command::Resolve;
  Format format = Format::Text;
  SessionOptions session;
  Question question;
  host::LogThreshold log = host::LogThreshold::Warning;
  std::string moduleFile; /* of modinfo */
};

/* What was asked for; nothing when the question was for help or the version, which is printed to
 * standard output then. Throws UsageError, whose text ends in where to find help. */
std::optional<CommandLine> parseCommandLine(int argc, char **argv);

}  // namespace cli
