// The option scan in-process: the record and bare arguments it produces for
// argument vectors, and the status of the scans that end the run.

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "cli/options.h"

// Readable failure output for the whole record.
void PrintTo(const VSRunOptions &o, std::ostream *os) {
    auto text = [](const std::optional<std::string> &s) { return s ? "\"" + *s + "\"" : std::string("none"); };
    *os << "{all=" << o.allProcesses << " json=" << text(o.jsonPath) << " children=" << o.targetChildren
        << " procs=[";
    for (const auto &p : o.processDescriptions) *os << p << ";";
    *os << "] excludes=[";
    for (const auto &x : o.excludeDescriptions) *os << x << ";";
    *os << "] pids=[";
    for (const auto &[pid, name] : o.pidTable) *os << pid << ":" << text(name) << ";";
    *os << "] skip=" << o.skipIdleExitClean << " verbose=" << o.verbose << " format=" << o.summaryFormat
        << " summarize=" << o.summarize << " outputOptions=" << o.outputOptions
        << " corpseMode=" << o.corpseMode << " corpsePid=" << o.corpsePid
        << " corpseName=" << text(o.corpseName) << " dirtyFlags=" << o.corpseDirtyFlags
        << " procFlags=" << o.corpseProcFlags << " breakDown=" << o.breakDownRequested << "}";
}

namespace {

struct ScanCase {
    std::vector<std::string> args;
    std::optional<int> exitStatus;  // set: the scan must end the run
    std::function<void(VSRunOptions &)> expect = [](VSRunOptions &) {};
    std::vector<std::string> bareArguments = {};
};

// Output of the scan is checked by the whole-program test; here it is only
// kept off the test log.
struct Discard {
    FILE *file = std::fopen("/dev/null", "w");
    ~Discard() { std::fclose(file); }
};

vs::OptionScanResult scan(std::vector<std::string> args, FILE *sink) {
    args.insert(args.begin(), "vestage");
    std::vector<char *> argv;
    for (auto &a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    return vs::scanOptions(static_cast<int>(args.size()), argv.data(), sink, sink);
}

TEST(OptionScan, ResultingOptions) {
    const ScanCase cases[] = {
        {{}, {}},
        {{"-f", "pages", "-f", "bytes"}, {}, [](VSRunOptions &o) { o.summaryFormat = VSSummaryFormatBytes; }},
        {{"--format", "pages"}, {}, [](VSRunOptions &o) { o.summaryFormat = VSSummaryFormatPages; }},
        {{"-f", "pages", "--form=formatted"}, {}, [](VSRunOptions &o) { o.summaryFormat = VSSummaryFormatFormatted; }},

        // --pid goes straight to the pid table, strtol style, cut to 32 bits.
        {{"--pid", "12abc"}, {}, [](VSRunOptions &o) { o.pidTable[12] = std::nullopt; }},
        {{"--pid", "-5"}, {}, [](VSRunOptions &o) { o.pidTable[-5] = std::nullopt; }},
        {{"--pid", " +7"}, {}, [](VSRunOptions &o) { o.pidTable[7] = std::nullopt; }},
        {{"--pid=4294967297", "--pi", "3"}, {}, [](VSRunOptions &o) {
             o.pidTable[1] = std::nullopt;
             o.pidTable[3] = std::nullopt;
         }},
        // -p and --proc keep the text for later resolution; duplicates collapse.
        {{"-p", "123", "--proc", "123", "--proc=abc", "-pdef"}, {}, [](VSRunOptions &o) {
             o.processDescriptions = {"123", "abc", "def"};
         }},
        {{"--pid", "123"}, {}, [](VSRunOptions &o) { o.pidTable[123] = std::nullopt; }},
        {{"--proc", "a", "--pid", "5", "--proc", "6"}, {}, [](VSRunOptions &o) {
             o.processDescriptions = {"a", "6"};
             o.pidTable[5] = std::nullopt;
         }},
        {{"-x", "1", "--exclude", "init", "-x", "1"}, {}, [](VSRunOptions &o) {
             o.excludeDescriptions = {"1", "init"};
         }},

        // Column bits accumulate.
        {{"-w"}, {}, [](VSRunOptions &o) { o.outputOptions = 3; }},
        {{"--wide"}, {}, [](VSRunOptions &o) { o.outputOptions = 3; }},
        {{"--swapped", "--wired"}, {}, [](VSRunOptions &o) { o.outputOptions = 3; }},
        {{"--wired"}, {}, [](VSRunOptions &o) { o.outputOptions = VSOutputOptionWired; }},
        {{"--swapped", "--swapped"}, {}, [](VSRunOptions &o) { o.outputOptions = VSOutputOptionSwapped; }},

        // Any corpse option switches corpse mode on; the values are not checked here.
        {{"--corpseName", "x"}, {}, [](VSRunOptions &o) {
             o.corpseMode = true;
             o.corpseName = "x";
         }},
        {{"--corpseName", "a", "--corpseName", "b"}, {}, [](VSRunOptions &o) {
             o.corpseMode = true;
             o.corpseName = "b";
         }},
        {{"--corpsePid", "abc"}, {}, [](VSRunOptions &o) {
             o.corpseMode = true;
             o.corpsePid = 0;
         }},
        {{"--corpsePid", "4294967296"}, {}, [](VSRunOptions &o) {
             o.corpseMode = true;
             o.corpsePid = 4294967296;
         }},
        {{"--corpseDirtyFlags", "0x1F", "--corpseProcFlags", "ff"}, {}, [](VSRunOptions &o) {
             o.corpseMode = true;
             o.corpseDirtyFlags = 0x1f;
             o.corpseProcFlags = 0xff;
         }},
        {{"--corpseProcFlags", "zz"}, {}, [](VSRunOptions &o) { o.corpseMode = true; }},

        // Unambiguous prefixes and the two spellings of an argument.
        {{"--sum"}, {}, [](VSRunOptions &o) { o.summarize = true; }},
        {{"--targetC"}, {}, [](VSRunOptions &o) { o.targetChildren = true; }},
        {{"--phys"}, {}, [](VSRunOptions &o) { o.breakDownRequested = true; }},
        {{"--sk", "--al"}, {}, [](VSRunOptions &o) {
             o.skipIdleExitClean = true;
             o.allProcesses = true;
         }},
        {{"--json=out.json"}, {}, [](VSRunOptions &o) { o.jsonPath = "out.json"; }},
        {{"--json", "out.json"}, {}, [](VSRunOptions &o) { o.jsonPath = "out.json"; }},
        {{"-j", "a.json", "-jb.json"}, {}, [](VSRunOptions &o) { o.jsonPath = "b.json"; }},
        {{"-avsyt"}, {}, [](VSRunOptions &o) {
             o.allProcesses = o.verbose = o.skipIdleExitClean = o.summarize = o.targetChildren = true;
         }},

        // Options and bare arguments mix; "--" ends the options.
        {{"123", "-v", "name", "--", "-a"},
         {},
         [](VSRunOptions &o) { o.verbose = true; },
         {"123", "name", "-a"}},
        {{"/tmp/heap", "-p", "x"}, {}, [](VSRunOptions &o) { o.processDescriptions = {"x"}; }, {"/tmp/heap"}},

        // Scans that end the run. Some stop inside a group of short
        // options, which the next scan must not resume.
        {{"-h"}, 0},
        {{"-vh"}, 0},
        {{"-h", "-f", "Formatted"}, 0},
        {{"-f", "Formatted", "-h"}, 1},
        {{"-vfFormatted", "-h"}, 1},
        {{"--pid", "abc", "-h"}, 1},
        {{"--pid", ""}, 1},
        {{"-vs"}, {}, [](VSRunOptions &o) { o.verbose = o.skipIdleExitClean = true; }},
    };

    Discard sink;
    for (const ScanCase &c : cases) {
        std::string label;
        for (const auto &a : c.args) label += " '" + a + "'";
        SCOPED_TRACE("vestage" + label);
        vs::OptionScanResult result = scan(c.args, sink.file);
        EXPECT_EQ(result.exitStatus, c.exitStatus);
        if (c.exitStatus) continue;
        VSRunOptions expected;
        c.expect(expected);
        EXPECT_EQ(result.options, expected);
        EXPECT_EQ(result.bareArguments, c.bareArguments);
    }
}

TEST(OptionScan, CorpseUsageText) {
    char *buffer = nullptr;
    size_t size = 0;
    FILE *out = open_memstream(&buffer, &size);
    ASSERT_NE(out, nullptr);
    printCorpseUsage(out);
    std::fclose(out);
    std::string text(buffer, size);
    std::free(buffer);
    EXPECT_EQ(text,
              "Usage: vestage --corpsePid pid --corpseName name --corpseDirtyFlags dirtyFlags --corpseProcFlags "
              "procFlags\n"
              "\t--corpsePid pid \t\t\t\tpid of the corpse passed to vestage\n"
              "\t--corpseName name \t\t\t\tname of the corpse passed to vestage\n"
              "\t--corpseDirtyFlags dirtyFlags \t\t\tdirty flags of the corpse passed to vestage in hex\n"
              "\t--corpseProcFlags procFlags \t\t\tproc flags of the corpse passed to vestage in hex\n");
}

}  // namespace
