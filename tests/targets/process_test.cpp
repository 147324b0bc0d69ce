// The process base and target discovery: names, the factory, description resolution, children, idle exit.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>

#include "targets/kernel_process.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::as;

class ProcessTest : public vs::testing::TargetTest {};

std::string withCount(uint32_t count, const std::string &rest) {
    std::string area(4, '\0');
    std::memcpy(area.data(), &count, 4);
    return area + rest;
}

TEST_F(ProcessTest, NameComesFromTheExecutablePathElseFromTheRecord) {
    using Builder = VSFakeProcessBuilder;
    const std::string thirtyTwo = "abcdefghijklmnopqrstuvwxyz012345";
    const std::vector<std::pair<std::function<void(Builder &)>, std::string>> cases = {
        {[](Builder &p) { p.commandName("bar").name("bar").executable("/usr/libexec/foo", {"x"}); }, "foo"},
        {[](Builder &p) { p.name("").commandName("abc"); }, "abc"}, {[](Builder &p) { p.name(""); }, "Unknown"},
        {[&](Builder &p) { p.name(thirtyTwo + "tail"); }, thirtyTwo},  // no terminator
        {[](Builder &p) { p.argumentArea(withCount(256, std::string("/bin/sh\0\0\0\0\0", 12))); }, "sh"},
        {[](Builder &p) { p.name("fallback").argumentArea(withCount(1, std::string(8, '\0'))); }, "fallback"},
        {[](Builder &p) { p.name("fallback").argumentArea(std::string("\x01\x00", 2)); }, "fallback"},
        {[](Builder &p) { p.name("fallback").executable("/bin/\xff\xfe"); }, "fallback"},
    };
    int32_t pid = 100;
    for (const auto &[script, expected] : cases) {
        auto builder = fake.process(++pid, "");
        script(builder);
        EXPECT_EQ(VSProcess::_nameForBsdInfo(builder.record().bsdInfo), expected) << "case " << pid - 100;
    }
}

TEST_F(ProcessTest, FactoryBuildsTheTargetKindTheRecordAsksFor) {
    auto daemon = as<VSUserProcess>(VSProcess::processWithPid(fake.process(5, "daemon").pid()));
    ASSERT_NE(daemon, nullptr);
    EXPECT_EQ(daemon->displayString(), "daemon [5]");
    // A kernel-flagged record is a kernel target whatever its pid; targets are equal by pid alone.
    VSBsdInfo record = fake.process(5).record().bsdInfo;
    record.flags |= vs::kBsdInfoFlagSystem;
    auto flagged = as<VSKernelProcess>(VSProcess::processWithBsdInfo(record));
    EXPECT_TRUE(flagged && flagged->isEqual(*daemon));
    EXPECT_EQ(VSProcess::processWithPid(77), nullptr);  // no such process: no target, and nothing to say
    EXPECT_TRUE(VSProcess::globalErrors().empty());
    fake.errorText(5, "permission refused").process(42, "locked").refuseTaskHandle(5);
    EXPECT_EQ(VSProcess::processWithPid(42), nullptr);
    EXPECT_EQ(VSProcess::globalErrors(), std::vector<std::string>{"task_handle_for_pid [42] permission refused"});
}

TEST_F(ProcessTest, DescriptionsResolveByNameFirstThenByNumber) {
    for (auto [pid, name] : std::vector<std::pair<int32_t, const char *>>{
             {1, "init"}, {5, "123"}, {123, "worker"}, {42, "server"}, {43, "server"}, {50, "-7"}}) {
        fake.process(pid, name);
    }
    // A zombie listed first, then two live ones of the same name.
    fake.process(60, "python3").zombie();
    fake.process(61, "python3");
    fake.process(62, "python3");
    const std::string none = "Unable to find pid for process matching ";
    const std::vector<std::tuple<std::vector<std::string>, VSPidTable, std::vector<std::string>>> cases = {
        {{"worker"}, {{123, "worker"}}, {}},
        {{"123"}, {{5, "123"}}, {}},  // a name listed earlier beats the pid
        {{" 42"}, {{42, std::nullopt}}, {}}, {{"+42"}, {{42, std::nullopt}}, {}}, {{"42abc"}, {{42, std::nullopt}}, {}},
        {{"x42"}, {}, {none + "'x42'"}}, {{"-42"}, {}, {none + "'-42'"}}, {{"-7"}, {{50, "-7"}}, {}},
        {{"work"}, {}, {none + "'work'"}},
        // The first of two with that name, and a word on the other.
        {{"server"}, {{42, "server"}}, {"'server' matches 2 processes; analysing 42; pick another with --pid: 43"}},
        // A zombie has nothing left to show while a live one matches.
        {{"python3"}, {{61, "python3"}},
         {"'python3' matches 3 processes; analysing 61; pick another with --pid: 60, 62"}},
        {{"init", "1"}, {{1, std::nullopt}}, {}}, {{"1", "init"}, {{1, "init"}}, {}},
        {{"nope", "worker", ""}, {{123, "worker"}}, {none + "'nope'", none + "''"}},
    };
    for (const auto &[descriptions, expected, expectedErrors] : cases) {
        SCOPED_TRACE(::testing::PrintToString(descriptions));
        std::vector<std::string> errors = {"stale"};
        EXPECT_EQ(VSProcess::pidsForStringDescriptions(descriptions, &errors), expected);
        EXPECT_EQ(errors, expectedErrors);
        EXPECT_EQ(VSProcess::pidsForStringDescriptions(descriptions), expected);  // unmatched dropped quietly
    }

    fake.failAlways(VSFakeQuery::ListAllPids, -1);
    std::vector<std::string> errors;
    EXPECT_FALSE(VSProcess::pidsForStringDescriptions({"init"}, &errors).has_value());
    EXPECT_EQ(errors, std::vector<std::string>{"Unable to obtain system process list"});
    EXPECT_FALSE(VSProcess::childPidsForPids({1}).has_value());
}

TEST_F(ProcessTest, ChildrenAreCollectedLevelByLevel) {
    fake.kernelProcess();
    for (auto [pid, parent] : std::vector<std::pair<int32_t, int32_t>>{{1, 0}, {10, 1}, {11, 1}, {20, 10}, {30, 20}}) {
        fake.process(pid, "p").parent(parent);
    }
    fake.process(12, "gone").parent(1).exited();
    const std::vector<std::pair<std::vector<int32_t>, std::vector<int32_t>>> cases = {
        {{30}, {30}}, {{}, {}}, {{1}, {1, 10, 11, 20, 30}}, {{10, 20}, {10, 20, 30}}, {{30, 20}, {30, 20}},
        {{999}, {999}},
        {{0}, {0, 1, 10, 11, 20, 30}},  // the kernel is its own parent; the walk still ends
        {{0, 0}, {0, 0, 1, 10, 11, 20, 30}},
    };
    for (const auto &[given, expected] : cases) {
        EXPECT_EQ(VSProcess::childPidsForPids(given), expected) << ::testing::PrintToString(given);
    }
}

TEST_F(ProcessTest, AllProcessesLeavesOutTheExcludedAndTheUnopenableAndIdleExitFilterDropsOnlyClean) {
    fake.kernelProcess();
    fake.process(20, "self");
    fake.process(30, "locked").refuseTaskHandle(5).residentSize(3 << 20);
    fake.process(31, "locked too").refuseTaskHandle(5).residentSize(1 << 20);
    // Dirty flags: tracked 0x1, idle exit allowed 0x2, dirty 0x4. Clean: 0x3 and 0xB; 0x7 is dirty.
    for (uint32_t flags : {0x1, 0x2, 0x3, 0xB, 0x7}) {
        fake.process(static_cast<int32_t>(100 + flags), "p").dirtyFlags(flags);
    }
    fake.process(200, "p").dirtyFlags(0x3).failAlways(VSFakeQuery::PidDirtyFlags, 3);  // unread: flags 0
    auto targets = VSProcess::allProcessesExcludingPids({20});
    ASSERT_TRUE(targets.has_value());
    EXPECT_EQ(targets->at(107)->idleExitStatus(), VSIdleExitDirty);
    // What the refused processes hold is known to be left out, and how much.
    EXPECT_EQ(VSProcess::uncountedResident(), std::make_pair(uint64_t{4 << 20}, 2u));
    std::vector<int64_t> keys;
    for (const auto &[pid, target] : VSProcess::removeIdleExitCleanProcessesFrom(std::move(*targets))) {
        keys.push_back(pid);
    }
    EXPECT_EQ(keys, (std::vector<int64_t>{0, 101, 102, 107, 200}));
}

}  // namespace
