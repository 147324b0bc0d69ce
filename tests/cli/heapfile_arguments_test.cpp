// Bare arguments naming existing files: heapfiles become targets under keys
// that never meet a pid, their breakdown modes must agree, and a file that
// is no heapfile still names a process when it can.

#include <gtest/gtest.h>

#include <climits>
#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "cli/heapfile_arguments.h"
#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::CapturedStream;
using vs::testing::ScratchFile;

// Runs the body with the working directory set to `directory`.
class WorkingDirectory {
public:
    explicit WorkingDirectory(const std::string &directory) : _previous(std::filesystem::current_path()) {
        std::filesystem::current_path(directory);
    }
    ~WorkingDirectory() { std::filesystem::current_path(_previous); }

private:
    std::filesystem::path _previous;
};

std::string heapfileText(bool breakDown, int32_t pid = 4242) {
    VSHeapfileSnapshot snapshot = vs::testing::snapshotOf({vs::testing::region({0x1000, 0x1000, "anon"})});
    snapshot.pid = pid;
    snapshot.breakDownPhysVestage = breakDown;
    return vs::heapfileText(snapshot);
}

class HeapfileArgumentsTest : public vs::testing::TargetTest {
protected:
    VSTargetMap targetMap;
    VSPidTable pidTable;
    CapturedStream err;
};

TEST_F(HeapfileArgumentsTest, BreakdownModesMustAgree) {
    ScratchFile with(heapfileText(true), "with.heap");
    ScratchFile without(heapfileText(false), "without.heap");
    const std::string conflict =
        "Heapfile was gathered with an analysis mode that conflicts with other heapfiles or command line "
        "arguments: ";
    struct Case {
        const char *what;
        vs::BreakdownModeState start;  // what --physVestage left
        std::vector<std::string> arguments;
        std::optional<int> status;
        bool breakDown;  // the mode afterwards (when the run goes on)
        std::string message;
    };
    const std::vector<Case> cases = {
        {"a heapfile with the breakdown switches it on", {false, false}, {with.path()}, std::nullopt, true, ""},
        {"one without leaves it off", {false, false}, {without.path()}, std::nullopt, false, ""},
        {"--physVestage and a heapfile with it agree", {true, true}, {with.path()}, std::nullopt, true, ""},
        {"--physVestage and a heapfile without it", {true, true}, {without.path()}, 1, true,
         conflict + without.path() + "\n"},
        {"with, then without: the second is named", {false, false}, {with.path(), without.path()}, 1, true,
         conflict + without.path() + "\n"},
        {"without, then with", {false, false}, {without.path(), with.path()}, 1, false, conflict + with.path() + "\n"},
        {"two that agree", {false, false}, {with.path(), with.path()}, std::nullopt, true, ""},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        CapturedStream stream;
        VSTargetMap targets;
        VSPidTable pids;
        vs::BreakdownModeState state = c.start;
        std::optional<int> status;
        for (const std::string &argument : c.arguments) {
            status = vs::loadHeapfileArgument(argument, state, targets, pids, stream.stream());
            if (status) {
                break;
            }
        }
        EXPECT_EQ(status, c.status);
        EXPECT_EQ(stream.text(), c.message);
        if (!status) {
            EXPECT_EQ(state.breakDown, c.breakDown);
            EXPECT_TRUE(state.fixed);
        }
        EXPECT_TRUE(pids.empty());
    }
}

TEST_F(HeapfileArgumentsTest, HeapfilesAreKeyedApartFromLivePids) {
    // A live process with the heapfile's pid: both targets must survive.
    ScratchFile file(heapfileText(false, 1));
    fake.process(1, "init");
    targetMap[1] = VSProcess::processWithPid(1);
    ASSERT_NE(targetMap[1], nullptr);

    vs::BreakdownModeState state;
    EXPECT_EQ(vs::loadHeapfileArgument(file.path(), state, targetMap, pidTable, err.stream()), std::nullopt);
    ASSERT_EQ(targetMap.size(), 2u);
    const int64_t key = vs::heapfileTargetKey(file.path());
    ASSERT_EQ(targetMap.count(key), 1u);
    EXPECT_EQ(targetMap[key]->displayString(), "worker [1] (heapfile)");
    EXPECT_EQ(targetMap[1]->displayString(), "init [1]");

    // The same path again loads again and replaces the first target.
    const VSProcess *first = targetMap[key].get();
    EXPECT_EQ(vs::loadHeapfileArgument(file.path(), state, targetMap, pidTable, err.stream()), std::nullopt);
    EXPECT_EQ(targetMap.size(), 2u);
    EXPECT_NE(targetMap[key].get(), first);
    EXPECT_EQ(err.text(), "");

    // Keys of different texts differ and all lie outside the pid range.
    std::set<int64_t> keys;
    for (const char *text : {"a", "b", "a.heap", "./a.heap", "/tmp/a.heap", "", "0", "2147483647"}) {
        const int64_t k = vs::heapfileTargetKey(text);
        EXPECT_LT(k, int64_t(INT32_MIN)) << text;
        keys.insert(k);
    }
    EXPECT_EQ(keys.size(), 8u);
}

TEST_F(HeapfileArgumentsTest, FilesThatAreNoHeapfileAreTriedAsProcessDescriptions) {
    fake.process(123, "other");
    fake.process(200, "worker");
    ScratchFile named("not a heapfile", "worker");
    ScratchFile number("not a heapfile either", "123");
    ScratchFile nothing("", "nothing-matches");
    WorkingDirectory here(named.directory());
    std::filesystem::copy_file(number.path(), "123");
    std::filesystem::copy_file(nothing.path(), "nothing-matches");

    struct Case {
        std::string argument;
        std::optional<int> status;
        VSPidTable pids;
        std::string message;
    };
    const std::vector<Case> cases = {
        {"worker", std::nullopt, {{200, "worker"}}, ""},
        {"123", std::nullopt, {{123, std::nullopt}}, ""},
        {"nothing-matches", 1, {}, "Error opening heapfile nothing-matches: the file is empty\n"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.argument);
        CapturedStream stream;
        VSTargetMap targets;
        VSPidTable pids;
        vs::BreakdownModeState state;
        EXPECT_EQ(vs::loadHeapfileArgument(c.argument, state, targets, pids, stream.stream()), c.status);
        EXPECT_EQ(pids, c.pids);
        EXPECT_TRUE(targets.empty());
        EXPECT_EQ(stream.text(), c.message);
        EXPECT_FALSE(state.fixed);  // only heapfiles fix the mode
    }
}

}  // namespace
