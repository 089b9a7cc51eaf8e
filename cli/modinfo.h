/* karst modinfo */
#pragma once

#include <filesystem>

#include "cli/output.h"
#include "cli/resolve.h"

namespace cli {

/* Prints what a module file says about itself. Throws host::ModuleError. */
int modinfo(const std::filesystem::path &file, Format format, Output &output);

}  // namespace cli
