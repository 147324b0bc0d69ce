#pragma once

#include <string>
#include <vector>

#include "cli/options.h"

// The whole program: option scan, run sequence, report. Returns the exit status.
int vsMain(int argc, char **argv);

namespace vs {

// Everything after the option scan: turns the options and the bare
// arguments (in command-line order) into targets and prints the report.
// Fatal errors are written here; returns the exit status.
int runSequence(VSRunOptions &options, const std::vector<std::string> &bareArguments);

}  // namespace vs
