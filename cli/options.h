#pragma once

#include <cstdint>
#include <cstdio>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "output/output_options.h"

// Everything the command line asked for. Options accumulate: repeated
// -p/-x/--pid add entries, repeated flags are harmless.
struct VSRunOptions {
    bool allProcesses = false;
    std::optional<std::string> jsonPath;  // present: also write the JSON report
    bool targetChildren = false;
    std::set<std::string> processDescriptions;  // pids or names, resolved later
    std::set<std::string> excludeDescriptions;
    // nullopt marks a pid given as a number, whose name is not known.
    std::map<int32_t, std::optional<std::string>> pidTable;
    bool skipIdleExitClean = false;
    bool verbose = false;
    int64_t summaryFormat = VSSummaryFormatFormatted;
    bool summarize = false;
    int64_t outputOptions = 0;  // VSOutputOption* bits
    bool corpseMode = false;
    int64_t corpsePid = -1;  // as parsed; checked only by the corpse checks
    std::optional<std::string> corpseName;
    uint64_t corpseDirtyFlags = 0;
    uint64_t corpseProcFlags = 0;
    bool breakDownRequested = false;
    std::optional<std::size_t> top;
    std::optional<std::string> openMetricsPath;  // present: also write the OpenMetrics text ("-": stdout)  // --top: at most this many lines instead of the report

    bool operator==(const VSRunOptions &) const = default;
};

// The main usage text, one line at a time, on `out`.
void printUsage(FILE *out = stdout);
// The usage text of the crash-snapshot arguments.
void printCorpseUsage(FILE *out = stdout);

namespace vs {

struct OptionScanResult {
    // Set when the scan has ended the run (-h, or a malformed option): the
    // diagnostics and usage text are already written, the program exits
    // with this status.
    std::optional<int> exitStatus;
    VSRunOptions options;
    // Arguments that are no options, in command-line order.
    std::vector<std::string> bareArguments;
};

// Scans argv with getopt_long. Resets getopt's global state first, so it
// may be called repeatedly in one process. getopt_long permutes argv and
// writes its own diagnostics (naming argv[0]) to standard error; the
// scan's messages go to `err`, usage texts to `out`.
OptionScanResult scanOptions(int argc, char **argv, FILE *out = stdout, FILE *err = stderr);

}  // namespace vs
