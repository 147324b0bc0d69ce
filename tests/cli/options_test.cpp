// The option scan in-process: the record and bare arguments it produces, and
// the status of scans that end the run (their output is a whole-run case).

#include <gtest/gtest.h>

#include <cstdio>
#include <functional>

#include "cli/options.h"

namespace {

TEST(OptionScan, ResultingOptions) {
    using O = VSRunOptions;
    const struct Case {
        std::vector<std::string> args;
        std::optional<int> exitStatus;  // set: the scan must end the run
        std::function<void(O &)> expect = [](O &) {};
        std::vector<std::string> bareArguments = {};
    } cases[] = {
        {{}, {}},
        {{"-f", "bytes", "--form=pages"}, {}, [](O &o) { o.summaryFormat = VSSummaryFormatPages; }},
        // --pid goes straight to the pid table, strtol style, cut to 32 bits.
        {{"--pid", "12abc", "--pid", " -5"}, {}, [](O &o) { o.pidTable = {{12, {}}, {-5, {}}}; }},
        {{"--pid=4294967297", "--pi", "3"}, {}, [](O &o) { o.pidTable = {{1, {}}, {3, {}}}; }},
        // -p and --proc keep the text for later resolution; duplicates collapse.
        {{"-p", "123", "--proc", "123", "--proc=abc", "-pdef"}, {},
         [](O &o) { o.processDescriptions = {"123", "abc", "def"}; }},
        // Column bits accumulate.
        {{"-w", "--wired"}, {}, [](O &o) { o.outputOptions = VSOutputOptionSwapped | VSOutputOptionWired; }},
        // Any corpse option switches corpse mode on; the values are not checked here.
        {{"--corpseName", "a", "--corpseName", "b", "--corpsePid", "abc"}, {},
         [](O &o) { o.corpseMode = true, o.corpseName = "b", o.corpsePid = 0; }},
        {{"--corpsePid", "4294967296", "--corpseDirtyFlags", "0x1F", "--corpseProcFlags", "ff"}, {},
         [](O &o) { o.corpseMode = true, o.corpsePid = 4294967296, o.corpseDirtyFlags = 31, o.corpseProcFlags = 255; }},
        // Unambiguous prefixes, the two spellings of an argument, grouped short options.
        {{"--sum", "--targetC", "--phys", "--sk"}, {},
         [](O &o) { o.summarize = o.targetChildren = o.breakDownRequested = o.skipIdleExitClean = true; }},
        {{"--json=a.json", "--json", "b.json", "-j", "c.json", "-jd.json"}, {}, [](O &o) { o.jsonPath = "d.json"; }},
        {{"-avsyt"}, {},
         [](O &o) { o.allProcesses = o.verbose = o.skipIdleExitClean = o.summarize = o.targetChildren = true; }},
        // Options and bare arguments mix; "--" ends the options.
        {{"123", "-v", "name", "--", "-a"}, {}, [](O &o) { o.verbose = true; }, {"123", "name", "-a"}},
        // Scans that end the run. Some stop inside a group of short options,
        // which the next scan must not resume.
        {{"-vh"}, 0},
        {{"-vfFormatted", "-h"}, 1},
        {{"-vs"}, {}, [](O &o) { o.verbose = o.skipIdleExitClean = true; }},
    };
    FILE *sink = std::fopen("/dev/null", "w");
    for (const Case &c : cases) {
        std::vector<std::string> args = c.args;
        args.insert(args.begin(), "vestage");
        SCOPED_TRACE(::testing::PrintToString(args));
        std::vector<char *> argv;
        for (auto &a : args) argv.push_back(a.data());
        argv.push_back(nullptr);
        const vs::OptionScanResult result = vs::scanOptions(static_cast<int>(args.size()), argv.data(), sink, sink);
        EXPECT_EQ(result.exitStatus, c.exitStatus);
        if (c.exitStatus) continue;
        VSRunOptions expected;
        c.expect(expected);
        EXPECT_EQ(result.options, expected);
        EXPECT_EQ(result.bareArguments, c.bareArguments);
    }
    std::fclose(sink);
}

}  // namespace
