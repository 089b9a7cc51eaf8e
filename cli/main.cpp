/* The karst command: asks the resolver, in a host kernel of its own. */
#include <csignal>
#include <cstdio>
#include <exception>

#include "cli/command_line.h"
#include "cli/modinfo.h"
#include "cli/watch.h"

namespace cli {
namespace {

int run(const CommandLine &line) {
  Output output;
  if (line.command == Command::Modinfo) return modinfo(line.moduleFile, line.format, output);
  host::setLogThreshold(line.log);
  if (line.command == Command::Watch) {
    const EndSignals signals;
    Session session(line.session);
    return watch(session, line.question, line.format, output, signals);
  }
  Session session(line.session);
  return resolve(session, line.question, line.format, output);
}

}  // namespace
}  // namespace cli

int main(int argc, char **argv) {
  std::signal(SIGPIPE, SIG_IGN); /* a reader that goes is an end like any other */
  try {
    const auto line = cli::parseCommandLine(argc, argv);
    return line ? cli::run(*line) : cli::kResolved;
  } catch (const cli::UsageError &error) {
    std::fprintf(stderr, "%s\n", error.what());
  } catch (const std::exception &error) {
    std::fprintf(stderr, "karst: %s\n", error.what());
  }
  return cli::kBadInput;
}
