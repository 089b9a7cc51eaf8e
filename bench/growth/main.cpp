/* karst-growth: how the cost of the resolver grows with nodes, interfaces, instances, changes a
 * second and readers, on this machine. Ends with 1 when a promise was broken on the way. */
#include <algorithm>
#include <cstdio>
#include <cstring>
#include <exception>
#include <fstream>
#include <nlohmann/json.hpp>

#include "bench/growth/series.h"
#include "host/kernel/log.h"

namespace {

constexpr char HELP[] =
    "usage: karst-growth [--json=FILE] [AXIS]...\n\n"
    "How the cost of the resolver grows along each axis, or along those that are named:\n"
    "  nodes       1 to 128, each with 4 interfaces: rescan, enable\n"
    "  interfaces  1 to 512: rescan, one change\n"
    "  instances   1 to 100,000 of one node: refresh, one change elsewhere, memory\n"
    "  events      changes a second, up to more than the resolver takes\n"
    "  readers     1 to 8 threads, of one instance and of one each\n\n"
    "Figures are medians of several rounds, +- half the distance between the quartiles.\n"
    "Exit status: 0; 1 when a promise was broken; 2 for a wrong command line.\n";

struct Axis {
  const char *name;
  growth::Series (*grow)();
};
constexpr Axis AXES[] = {{"nodes", growth::growNodes},
                         {"interfaces", growth::growInterfaces},
                         {"instances", growth::growInstances},
                         {"events", growth::growEvents},
                         {"readers", growth::growReaders}};

bool isAxis(const std::string &name) {
  for (const Axis &axis : AXES) {
    if (name == axis.name) return true;
  }
  return false;
}

int run(const std::vector<std::string> &wanted, const std::string &jsonFile) {
  std::vector<growth::Series> all;
  bool kept = true;
  for (const Axis &axis : AXES) {
    if (!wanted.empty() && std::find(wanted.begin(), wanted.end(), axis.name) == wanted.end()) {
      continue;
    }
    all.push_back(axis.grow());
    growth::print(all.back());
    std::fflush(stdout);
    kept &= all.back().kept();
  }
  if (!jsonFile.empty()) {
    std::ofstream out(jsonFile);
    out << growth::json(all).dump(1) << "\n";
    if (!out.flush()) throw std::runtime_error(jsonFile + " cannot be written");
  }
  return kept ? 0 : 1;
}

}  // namespace

int main(int argc, char **argv) {
  const std::string jsonOption = "--json=";
  std::string jsonFile;
  std::vector<std::string> wanted;
  for (int i = 1; i < argc; i++) {
    const std::string argument = argv[i];
    if (argument == "--help") {
      std::fputs(HELP, stdout);
      return 0;
    }
    if (argument.rfind(jsonOption, 0) == 0) {
      jsonFile = argument.substr(jsonOption.size());
    } else if (isAxis(argument)) {
      wanted.push_back(argument);
    } else {
      std::fprintf(stderr, "karst-growth: %s is neither an option nor an axis\n\n%s",
                   argument.c_str(), HELP);
      return 2;
    }
  }
  host::setLogThreshold(host::LogThreshold::Warning);
  try {
    return run(wanted, jsonFile);
  } catch (const std::exception &error) {
    std::fprintf(stderr, "karst-growth: %s\n", error.what());
    return 1;
  }
}
