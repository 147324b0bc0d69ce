// Whole runs of the built program: stdout, stderr and exit status compared
// byte for byte. argv[0] is fixed to "vestage" because the option parser's
// own diagnostics name it; the locale is fixed so they are not translated.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/support/run_program.h"

namespace {

using vs::test::RunResult;
using vs::test::runProgram;

const char *const kUsage =
    "Gather memory information about a process or set of processes\n"
    "Usage: vestage [args] [proc/pid/heapfile [proc/pid/heapfile [...]]]\n"
    "\t-a, --all \t\t\t\ttarget all processes\n"
    "\t-j, --json <file> \t\t\tprint json output to a file\n"
    "\t-h, --help \t\t\t\tprint this output\n"
    "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)\n"
    "\t-x, --exclude [proc/pid] \t\texclude pid or process\n"
    "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean\n"
    "\t-v \t\t\t\t\tspanlist-like output of address space layout\n"
    "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)\n"
    "\t-y, --summary\t\t\t\tprint only dirty regions, and always exclude __TEXT, __DATA and __LINKEDIT "
    "regions\n"
    "\t-w, --wide\t\t\t\tshow wide output with all columns (implies --swapped --wired)\n"
    "\t--swapped\t\t\t\tshow swapped/compressed column\n"
    "\t--wired\t\t\t\t\tshow wired column\n";

const char *const kNothingToAnalyse = "Must specify at least one process or heapfile\n";
const char *const kBadFormat =
    "Unrecognized argument to -f / --format.\n\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n";

std::string badPid(const std::string &text) {
    return "'" + text +
           "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process "
           "name.\n";
}


struct ProgramCase {
    std::vector<std::string> args;
    std::string out;
    std::string err;
    int status;
};

TEST(ProgramRun, OptionScanOutcomes) {
    const std::string usage = kUsage;
    const ProgramCase cases[] = {
        // Help wins only if it is reached.
        {{"-h"}, usage, "", 0},
        {{"--help"}, usage, "", 0},
        {{"--he"}, usage, "", 0},
        {{"-vh", "--bogus"}, usage, "", 0},
        {{"-h", "-f", "Formatted"}, usage, "", 0},
        {{"-f", "Formatted", "-h"}, "", kBadFormat, 1},
        {{"--format=Bytes"}, "", kBadFormat, 1},
        {{"-f", ""}, "", kBadFormat, 1},
        {{"-f", "pagesx"}, "", kBadFormat, 1},

        // --pid wants at least one digit; -p would take a name.
        {{"--pid", "abc"}, "", badPid("abc"), 1},
        {{"--pid", ""}, "", badPid(""), 1},
        {{"--pid", " "}, "", badPid(" "), 1},
        {{"--pid=-"}, "", badPid("-"), 1},
        {{"--pid", "7", "--pid", "x7"}, "", badPid("x7"), 1},

        // The option parser's diagnostics come first, then the usage text.
        {{"--v"}, usage, "vestage: unrecognized option '--v'\n", 1},
        {{"--corpse", "x"},
         usage,
         "vestage: option '--corpse' is ambiguous; possibilities: '--corpsePid' '--corpseName' "
         "'--corpseDirtyFlags' '--corpseProcFlags'\n",
         1},
        {{"--s"}, usage, "vestage: option '--s' is ambiguous; possibilities: '--skip' '--summary' '--swapped'\n", 1},
        {{"-b"}, usage, "vestage: invalid option -- 'b'\n", 1},
        {{"-j"}, usage, "vestage: option requires an argument -- 'j'\n", 1},
        {{"-v", "-f"}, usage, "vestage: option requires an argument -- 'f'\n", 1},
        {{"--json"}, usage, "vestage: option '--json' requires an argument\n", 1},
        {{"--all=yes"}, usage, "vestage: option '--all' doesn't allow an argument\n", 1},
        {{"--skip=1"}, usage, "vestage: option '--skip' doesn't allow an argument\n", 1},
        {{"--pid"}, usage, "vestage: option '--pid' requires an argument\n", 1},

        // Accepted options that name no target: the run stops before any gathering.
        {{}, usage, kNothingToAnalyse, 1},
        {{"-v", "-f", "pages", "-f", "bytes"}, usage, kNothingToAnalyse, 1},
        {{"-w", "--swapped", "--wired", "--sum", "--targetC", "-s"}, usage, kNothingToAnalyse, 1},
        {{"--json=out.json", "--physVestage"}, usage, kNothingToAnalyse, 1},
        {{"-x", "1", "--exclude", "init"}, usage, kNothingToAnalyse, 1},
        {{"--"}, usage, kNothingToAnalyse, 1},
    };
    for (const ProgramCase &c : cases) {
        std::string label = "vestage";
        for (const auto &a : c.args) label += " '" + a + "'";
        SCOPED_TRACE(label);
        RunResult r = runProgram(c.args);
        EXPECT_EQ(r.out, c.out);
        EXPECT_EQ(r.err, c.err);
        EXPECT_EQ(r.status, c.status);
    }
}

}  // namespace
