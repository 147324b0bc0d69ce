// Bare arguments naming existing files: heapfiles become targets keyed apart
// from pids, with agreeing modes; other files may still name a process.

#include <gtest/gtest.h>

#include <climits>
#include <filesystem>
#include <fstream>

#include "cli/heapfile_arguments.h"
#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::CapturedStream;
using vs::testing::ScratchFile;
using HeapfileArgumentsTest = vs::testing::TargetTest;

std::string heapfileText(bool breakDown) {  // of pid 1
    VSHeapfileSnapshot snapshot = vs::testing::snapshotOf({vs::testing::region({0x1000, 0x1000, "anon"})});
    snapshot.pid = 1, snapshot.breakDownPhysVestage = breakDown;
    return vs::heapfileText(snapshot);
}

// Arguments in turn until one ends the run, in a directory holding
// with.heap, without.heap (breakdown mode on and off, pid 1) and the files
// "worker", "123" (no heapfile) and "nothing-matches" (empty). A live
// process with the heapfiles' pid is a target already: both must survive.
TEST_F(HeapfileArgumentsTest, ModesMustAgreeAndOtherFilesNameProcesses) {
    fake.process(1, "init"), fake.process(123, "other"), fake.process(200, "worker");
    ScratchFile worker("not a heapfile", "worker");
    const std::filesystem::path previous = std::filesystem::current_path();
    std::filesystem::current_path(worker.directory());
    std::ofstream("with.heap") << heapfileText(true);
    std::ofstream("without.heap") << heapfileText(false);
    std::ofstream("123") << "no heapfile either";
    std::ofstream("nothing-matches");
    const std::string conflict = "Heapfile was gathered with an analysis mode that conflicts with other heapfiles "
                                 "or command line arguments: ";
    const struct Case {
        bool physVestage;  // --physVestage given: the mode fixed on
        std::vector<std::string> arguments;
        std::string message;  // none: the run goes on
        VSPidTable pids = {};
    } cases[] = {
        {false, {"with.heap", "with.heap"}, ""},
        {false, {"without.heap"}, ""},
        {true, {"without.heap"}, conflict + "without.heap\n"},
        {false, {"with.heap", "without.heap"}, conflict + "without.heap\n"},
        {false, {"without.heap", "with.heap"}, conflict + "with.heap\n"},
        {false, {"worker"}, "", {{200, "worker"}}},
        {false, {"123"}, "", {{123, std::nullopt}}},
        {false, {"nothing-matches"}, "Error opening heapfile nothing-matches: the file is empty\n"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.arguments[0] + (c.physVestage ? " with --physVestage" : ""));
        CapturedStream stream;
        VSTargetMap targets;
        targets[1] = VSProcess::processWithPid(1);
        VSPidTable pids;
        vs::BreakdownModeState state{c.physVestage, c.physVestage};
        std::optional<int> status;
        for (auto argument = c.arguments.begin(); !status && argument != c.arguments.end(); ++argument) {
            status = vs::loadHeapfileArgument(*argument, state, targets, pids, stream.stream());
        }
        EXPECT_EQ(stream.text(), c.message);
        EXPECT_EQ(status, c.message.empty() ? std::nullopt : std::optional(1));
        EXPECT_EQ(pids, c.pids);
        const bool heapfile = c.arguments[0].ends_with(".heap");
        EXPECT_EQ(state.fixed, heapfile || c.physVestage);  // only heapfiles fix the mode
        if (!status) {
            EXPECT_EQ(state.breakDown, c.arguments[0] == "with.heap");
            EXPECT_EQ(targets.size(), heapfile ? 2u : 1u);  // loaded twice: the target replaced
        }
        // Heapfiles are keyed outside the pid range.
        for (const auto &[key, target] : targets) {
            EXPECT_EQ(target->displayString(), key == 1 ? "init [1]" : "worker [1] (heapfile)");
            EXPECT_TRUE(key == 1 || key < int64_t(INT32_MIN)) << key;
        }
    }
    std::filesystem::current_path(previous);
}

}  // namespace
