#include "cli/options.h"

#include <getopt.h>  // argument parsing only, no system service

#include <cstdlib>
#include <cstring>

namespace {

// Values of the options that have no short form.
enum : int {
    OptionCorpsePid = 256,
    OptionCorpseName = 257,
    OptionCorpseDirtyFlags = 258,
    OptionCorpseProcFlags = 259,
    OptionPhysVestage = 260,
    OptionSwapped = 261,
    OptionWired = 262,
    OptionTop = 263,
    OptionOpenMetrics = 264,
};

void putLine(FILE *out, const char *line) {
    std::fputs(line, out);
    std::fputc('\n', out);
}

bool parseSummaryFormat(const char *word, int64_t &format) {
    static const struct {
        const char *word;
        int64_t format;
    } formats[] = {
        {"bytes", VSSummaryFormatBytes},
        {"formatted", VSSummaryFormatFormatted},
        {"pages", VSSummaryFormatPages},
    };
    for (const auto &candidate : formats) {
        if (std::strcmp(word, candidate.word) == 0) {
            format = candidate.format;
            return true;
        }
    }
    return false;
}

// strtol semantics: leading blanks and a sign are fine, trailing junk is
// ignored; only an argument without any digit is refused.
bool parsePid(const char *text, int32_t &pid) {
    char *end = nullptr;
    long value = std::strtol(text, &end, 10);
    if (end == text) {
        return false;
    }
    pid = static_cast<int32_t>(value);
    return true;
}

}  // namespace

void printUsage(FILE *out) {
    putLine(out, "Gather memory information about a process or set of processes");
    putLine(out, "Usage: vestage [args] [proc/pid/heapfile [proc/pid/heapfile [...]]]");
    putLine(out, "\t-a, --all \t\t\t\ttarget all processes");
    putLine(out, "\t-j, --json <file> \t\t\tprint json output to a file");
    putLine(out, "\t-h, --help \t\t\t\tprint this output");
    putLine(out, "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)");
    putLine(out, "\t-x, --exclude [proc/pid] \t\texclude pid or process");
    putLine(out, "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean");
    putLine(out, "\t-v \t\t\t\t\tspanlist-like output of address space layout");
    putLine(out, "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)");
    putLine(out, "\t-y, --summary\t\t\t\tprint only dirty regions, and always exclude __TEXT, __DATA and __LINKEDIT regions");
    putLine(out, "\t-w, --wide\t\t\t\tshow wide output with all columns (implies --swapped --wired)");
    putLine(out, "\t--swapped\t\t\t\tshow swapped/compressed column");
    putLine(out, "\t--wired\t\t\t\t\tshow wired column");
    putLine(out, "\t-j -, --json -\t\t\t\twrite the json document to standard output instead of the text report");
    putLine(out, "\t--top[=N]\t\t\t\tone line per process, largest vestage first (default: 20 lines)");
    putLine(out, "\t--openmetrics <file> \t\t\twrite the figures in the OpenMetrics text format (- for standard output)");
    putLine(out, "\t--version\t\t\t\tprint the version and exit");
}

void printCorpseUsage(FILE *out) {
    putLine(out, "Usage: vestage --corpsePid pid --corpseName name --corpseDirtyFlags dirtyFlags --corpseProcFlags procFlags");
    putLine(out, "\t--corpsePid pid \t\t\t\tpid of the corpse passed to vestage");
    putLine(out, "\t--corpseName name \t\t\t\tname of the corpse passed to vestage");
    putLine(out, "\t--corpseDirtyFlags dirtyFlags \t\t\tdirty flags of the corpse passed to vestage in hex");
    putLine(out, "\t--corpseProcFlags procFlags \t\t\tproc flags of the corpse passed to vestage in hex");
}

namespace vs {

OptionScanResult scanOptions(int argc, char **argv, FILE *out, FILE *err) {
    OptionScanResult result;
    VSRunOptions &options = result.options;

    // --proc and --pid report themselves through these cells (getopt_long
    // then returns 0), so the long forms stay distinct from -p.
    int procCell = 0;
    int pidCell = 0;
    const struct option longOptions[] = {
        {"all", no_argument, nullptr, 'a'},
        {"json", required_argument, nullptr, 'j'},
        {"help", no_argument, nullptr, 'h'},
        {"targetChildren", no_argument, nullptr, 't'},
        {"proc", required_argument, &procCell, 1},
        {"exclude", required_argument, nullptr, 'x'},
        {"pid", required_argument, &pidCell, 1},
        {"skip", no_argument, nullptr, 's'},
        {"format", required_argument, nullptr, 'f'},
        {"summary", no_argument, nullptr, 'y'},
        {"corpsePid", required_argument, nullptr, OptionCorpsePid},
        {"corpseName", required_argument, nullptr, OptionCorpseName},
        {"corpseDirtyFlags", required_argument, nullptr, OptionCorpseDirtyFlags},
        {"corpseProcFlags", required_argument, nullptr, OptionCorpseProcFlags},
        {"physVestage", no_argument, nullptr, OptionPhysVestage},
        {"wide", no_argument, nullptr, 'w'},
        {"swapped", no_argument, nullptr, OptionSwapped},
        {"wired", no_argument, nullptr, OptionWired},
        {"top", optional_argument, nullptr, OptionTop},
        {"openmetrics", required_argument, nullptr, OptionOpenMetrics},
        {nullptr, 0, nullptr, 0},
    };

    auto fail = [&](int status) {
        result.exitStatus = status;
        return result;
    };
    auto failWithUsage = [&](int status) {
        printUsage(out);
        return fail(status);
    };
    auto addPid = [&](const char *text) {
        int32_t pid = 0;
        if (!parsePid(text, pid)) {
            std::fprintf(err,
                         "'%s' is not a valid integer for --pid.\n\n"
                         "Use -p / --proc if you meant to specify a process name.\n",
                         text);
            return false;
        }
        options.pidTable[pid] = std::nullopt;
        return true;
    };

    // --version is not one of getopt's long options: with it, "--v" would
    // abbreviate it instead of being the unknown option it always was.
    if (argc >= 2 && std::strcmp(argv[1], "--version") == 0) {
        std::fprintf(out, "vestage %s\n", VESTAGE_VERSION);
        return fail(0);
    }

    // 0 makes glibc forget the previous scan entirely (including a
    // half-read group of short options).
    optind = 0;
    int option;
    while ((option = getopt_long(argc, argv, "aj:htp:x:svf:yw", longOptions, nullptr)) != -1) {
        switch (option) {
        case 0:
            if (procCell) {
                options.processDescriptions.insert(optarg);
                procCell = 0;
            } else if (pidCell) {
                pidCell = 0;
                if (!addPid(optarg)) {
                    return fail(1);
                }
            }
            break;
        case 'a':
            options.allProcesses = true;
            break;
        case 'j':
            options.jsonPath = optarg;
            break;
        case 'h':
            return failWithUsage(0);
        case 't':
            options.targetChildren = true;
            break;
        case 'p':
            options.processDescriptions.insert(optarg);
            break;
        case 'x':
            options.excludeDescriptions.insert(optarg);
            break;
        case 's':
            options.skipIdleExitClean = true;
            break;
        case 'v':
            options.verbose = true;
            break;
        case 'f':
            if (!parseSummaryFormat(optarg, options.summaryFormat)) {
                std::fputs("Unrecognized argument to -f / --format.\n\n"
                           "Accepted arguments: 'bytes', 'formatted', 'pages'.\n",
                           err);
                return fail(1);
            }
            break;
        case 'y':
            options.summarize = true;
            break;
        case 'w':
            options.outputOptions |= VSOutputOptionWired | VSOutputOptionSwapped;
            break;
        case OptionCorpsePid:
            options.corpsePid = std::strtol(optarg, nullptr, 10);
            options.corpseMode = true;
            break;
        case OptionCorpseName:
            options.corpseName = optarg;
            options.corpseMode = true;
            break;
        case OptionCorpseDirtyFlags:
            options.corpseDirtyFlags = static_cast<uint64_t>(std::strtol(optarg, nullptr, 16));
            options.corpseMode = true;
            break;
        case OptionCorpseProcFlags:
            options.corpseProcFlags = static_cast<uint64_t>(std::strtol(optarg, nullptr, 16));
            options.corpseMode = true;
            break;
        case OptionPhysVestage:
            options.breakDownRequested = true;
            break;
        case OptionSwapped:
            options.outputOptions |= VSOutputOptionSwapped;
            break;
        case OptionWired:
            options.outputOptions |= VSOutputOptionWired;
            break;
        case OptionOpenMetrics:
            options.openMetricsPath = optarg;
            break;
        case OptionTop: {
            constexpr std::size_t kDefaultTopLines = 20;
            char *end = nullptr;
            const long lines = optarg ? std::strtol(optarg, &end, 10) : static_cast<long>(kDefaultTopLines);
            if (optarg && (end == optarg || *end != '\0' || lines < 1)) {
                std::fprintf(err, "--top wants a number of lines above 0, not '%s'.\n", optarg);
                return fail(1);
            }
            options.top = static_cast<std::size_t>(lines);
            break;
        }

        default:
            // '?' or ':' after getopt_long's own diagnostic, or a value
            // no branch above knows.
            return failWithUsage(1);
        }
    }

    for (int i = optind; i < argc; ++i) {
        result.bareArguments.emplace_back(argv[i]);
    }
    return result;
}

}  // namespace vs
