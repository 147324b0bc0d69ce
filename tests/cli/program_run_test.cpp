// Whole runs of the built program that end before any gathering: standard
// output, error and exit status byte for byte.

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
    "\t--wired\t\t\t\t\tshow wired column\n"
    "\t-j -, --json -\t\t\t\twrite the json document to standard output instead of the text report\n"
    "\t--top[=N]\t\t\t\tone line per process, largest vestage first (default: 20 lines)\n"
    "\t--openmetrics <file> \t\t\twrite the figures in the OpenMetrics text format (- for standard output)\n"
    "\t--version\t\t\t\tprint the version and exit\n";

const char *const kCorpseUsage =
    "Usage: vestage --corpsePid pid --corpseName name --corpseDirtyFlags dirtyFlags --corpseProcFlags procFlags\n"
    "\t--corpsePid pid \t\t\t\tpid of the corpse passed to vestage\n"
    "\t--corpseName name \t\t\t\tname of the corpse passed to vestage\n"
    "\t--corpseDirtyFlags dirtyFlags \t\t\tdirty flags of the corpse passed to vestage in hex\n"
    "\t--corpseProcFlags procFlags \t\t\tproc flags of the corpse passed to vestage in hex\n";

const char *const kNothingToAnalyse = "Must specify at least one process or heapfile\n";
const char *const kBadCorpse = "Invalid arguments for corpse mode\n";
const char *const kBadFormat =
    "Unrecognized argument to -f / --format.\n\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n";

TEST(ProgramRun, OptionScanAndTargetOutcomes) {
    const std::string usage = kUsage, self = std::to_string(getpid());
    const std::string noneFound =
        "Unable to find any processes matching the supplied process names or pids (try as root?)\n";
    const struct Case {
        std::vector<std::string> args;
        std::string out, err;
        int status;
    } cases[] = {
        // Help wins only if it is reached.
        {{"--he"}, usage, "", 0},
        {{"--version"}, "vestage 0.1\n", "", 0},
        {{"--vers"}, usage, "vestage: unrecognized option '--vers'\n", 1},
        {{"--top=0", "-a"}, "", "--top wants a number of lines above 0, not '0'.\n", 1},
        {{"--top=x"}, "", "--top wants a number of lines above 0, not 'x'.\n", 1},
        {{"-h", "-f", "Formatted"}, usage, "", 0},
        {{"-f", "Formatted", "-h"}, "", kBadFormat, 1},
        {{"--format=Bytes"}, "", kBadFormat, 1},
        // --pid wants at least one digit; -p would take a name.
        {{"--pid", "abc"}, "",
         "'abc' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process name.\n", 1},
        // The option parser's diagnostics come first, then the usage text.
        {{"--v"}, usage, "vestage: unrecognized option '--v'\n", 1},
        {{"--corpse", "x"}, usage,
         "vestage: option '--corpse' is ambiguous; possibilities: '--corpsePid' '--corpseName' "
         "'--corpseDirtyFlags' '--corpseProcFlags'\n",
         1},
        {{"-b"}, usage, "vestage: invalid option -- 'b'\n", 1},
        {{"-v", "-f"}, usage, "vestage: option requires an argument -- 'f'\n", 1},
        {{"--json"}, usage, "vestage: option '--json' requires an argument\n", 1},
        {{"--all=yes"}, usage, "vestage: option '--all' doesn't allow an argument\n", 1},
        // Accepted options that name no target: the run stops before any gathering.
        {{}, usage, kNothingToAnalyse, 1},
        {{"-w", "--sum", "--targetC", "-s", "--json=out.json", "--physVestage", "-x", "1", "--"}, usage,
         kNothingToAnalyse, 1},
        // Corpse arguments are checked before any descriptor is looked at.
        {{"--corpseName", "n", "--corpsePid", "0"}, kCorpseUsage, kBadCorpse, 1},
        {{"--corpseName", "x"}, kCorpseUsage, kBadCorpse, 1},
        {{"--corpsePid", self}, kCorpseUsage, kBadCorpse, 1},
        {{"--corpsePid", "4294967296", "--corpseName", "n"}, kCorpseUsage, kBadCorpse, 1},  // 0 in 32 bits
        // Targets that cannot be found or are all excluded.
        {{"-p", "no-such-process-name"}, "",
         "Unable to find pid for process matching 'no-such-process-name'\n" + noneFound, 1},
        {{"--pid", "2147483000"}, "", "Unable to analyze process with pid 2147483000 (try as root?)\n" + noneFound, 1},
        {{"--pid", self, "-x", self}, "", noneFound, 1},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.args));
        const RunResult r = runProgram(c.args);
        EXPECT_EQ(r.out, c.out);
        EXPECT_EQ(r.err, c.err);
        EXPECT_EQ(r.status, c.status);
    }
}

}  // namespace
