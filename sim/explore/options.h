/* The command line of the explorer. No lock. */
#pragma once

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include "sim/explore/explore.h"
#include "sim/explore/search.h"

namespace sim {

/* What is wrong with the command line, and what to do about it. */
struct UsageError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Options {
  bool list = false;
  std::filesystem::path regressions; /* empty: none are asked for */
  uint64_t determinismRuns = 0;      /* 0: not asked for */

  std::string scenario = "all";
  uint64_t seed = 1;
  std::string strategy = "portfolio";
  size_t length = 0;
  Budget budget;

  /* One case, written out. */
  std::optional<std::string> operations;
  std::optional<std::string> faults;
  std::optional<std::string> schedule;
  bool oneCase() const { return operations || faults || schedule; }

  std::filesystem::path module;
  std::string moduleOption;  /* the option that chooses this module */
  bool moduleChosen = false; /* by such an option, and not by default */
  unsigned jobs = 1;
  uint64_t shortenRuns = 4000;
  std::filesystem::path json; /* empty: not asked for */
};

/* Nothing when all that was asked for was help, which is printed. Throws UsageError. */
std::optional<Options> parseOptions(int argc, char **argv, const ExploreDefaults &defaults);

/* The same from one line of text, as it stands in a file of cases. */
Options parseLine(const std::string &line, const ExploreDefaults &defaults);

}  // namespace sim
