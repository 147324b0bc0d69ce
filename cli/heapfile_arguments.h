#pragma once

// Bare command-line arguments that name existing files. Each is loaded as
// a heapfile target; a file that is no heapfile is tried once more as a
// process description. All heapfiles of a run, and --physVestage, must
// agree on the physical-vestage breakdown mode, because the mode is
// switched for the whole run.

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>

#include "targets/process.h"

namespace vs {

// The run's breakdown mode while arguments are loaded. Both fields start as
// the --physVestage request: the option fixes the mode before the first
// heapfile is read.
struct BreakdownModeState {
    bool breakDown = false;
    bool fixed = false;
};

// The targetMap key of a heapfile argument.
//
// Live and corpse targets are keyed by pid, a small non-negative number.
// Heapfile targets are keyed by the 64-bit FNV-1a hash of the argument's
// text with the top bit set and the next bit cleared: as a signed key that
// is always below -2^62, far outside the 32-bit pid range, so a heapfile can
// never replace a live target or be replaced by one. The same text gives the
// same key, so a path given twice loads twice and the second target
// replaces the first.
int64_t heapfileTargetKey(std::string_view argument);

// Loads one bare argument that names an existing file, in command-line
// order, before any other target is resolved:
// - a heapfile: stored in `targetMap` under heapfileTargetKey(argument); its
//   breakdown mode must match the mode when that is fixed, and otherwise
//   becomes the mode and fixes it;
// - anything else: resolved as one process description; the pid found goes
//   into `pidTable` with the matched name (or no name for a pid number).
// Returns nullopt to go on, or the exit status (1) when the run must end;
// the message is already written to `err` then.
std::optional<int> loadHeapfileArgument(const std::string &argument, BreakdownModeState &state,
                                        VSTargetMap &targetMap, VSPidTable &pidTable, FILE *err = stderr);

}  // namespace vs
