// The process base and target discovery on the scripted platform: names,
// the factory, description resolution, children, idle-exit filtering,
// auxiliary data and the breakdown switch.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "targets/kernel_process.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::BareTarget;
using vs::testing::TargetTest;
using vs::testing::userProcess;

class ProcessTest : public TargetTest {};

std::string withCount(uint32_t count, const std::string &rest) {
    std::string area(4, '\0');
    std::memcpy(area.data(), &count, 4);
    return area + rest;
}

TEST_F(ProcessTest, NameComesFromTheExecutablePathElseFromTheRecord) {
    struct Case {
        const char *what;
        std::function<void(VSFakeProcessBuilder &)> script;
        std::string expected;
    };
    const std::string thirtyTwo = "abcdefghijklmnopqrstuvwxyz012345";
    const std::vector<Case> cases = {
        {"last path component, whatever the record says",
         [](VSFakeProcessBuilder &p) { p.commandName("bar").name("bar").executable("/usr/libexec/foo", {"x"}); },
         "foo"},
        {"no argument area: the 32-byte name",
         [](VSFakeProcessBuilder &p) { p.name("longer-process-name").commandName("short"); }, "longer-process-name"},
        {"empty name field: the command name", [](VSFakeProcessBuilder &p) { p.name("").commandName("abc"); },
         "abc"},
        {"both fields empty", [](VSFakeProcessBuilder &p) { p.name("").commandName(""); }, "Unknown"},
        {"a name field without a terminator", [&](VSFakeProcessBuilder &p) { p.name(thirtyTwo + "tail"); },
         thirtyTwo},
        {"an argument count that is a multiple of 256",
         [](VSFakeProcessBuilder &p) { p.argumentArea(withCount(256, std::string("/bin/sh\0\0\0\0\0", 12))); },
         "sh"},
        {"a path right after the count, without padding",
         [](VSFakeProcessBuilder &p) { p.argumentArea(withCount(1, std::string("/opt/tool\0arg\0", 14))); },
         "tool"},
        {"nothing but padding after the count",
         [](VSFakeProcessBuilder &p) { p.name("fallback").argumentArea(withCount(1, std::string(8, '\0'))); },
         "fallback"},
        {"an area shorter than the count",
         [](VSFakeProcessBuilder &p) { p.name("fallback").argumentArea(std::string("\x01\x00", 2)); }, "fallback"},
        {"a path that is not text",
         [](VSFakeProcessBuilder &p) { p.name("fallback").executable("/bin/\xff\xfe"); }, "fallback"},
        {"a path without a slash", [](VSFakeProcessBuilder &p) { p.executable("plain"); }, "plain"},
    };
    int32_t pid = 100;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        auto builder = fake.process(++pid, "");
        c.script(builder);
        EXPECT_EQ(VSProcess::_nameForBsdInfo(builder.record().bsdInfo), c.expected);
    }
}

TEST_F(ProcessTest, FactoryBuildsTheTargetKindTheRecordAsksFor) {
    fake.pageSize(16384);
    fake.process(1, "init").executable("/sbin/init");
    fake.process(5, "daemon").is64bit(false);
    fake.kernelProcess();

    auto init = VSProcess::processWithPid(1);
    ASSERT_NE(init, nullptr);
    EXPECT_NE(dynamic_cast<VSUserProcess *>(init.get()), nullptr);
    EXPECT_EQ(init->displayString(), "init [1]");
    EXPECT_TRUE(init->is64bit());
    EXPECT_EQ(init->pageSize(), 16384u);
    EXPECT_TRUE(init->_isAlive());
    EXPECT_FALSE(init->hasMemoryRegions());
    EXPECT_EQ(init->asNumber(), 1);

    auto daemon = VSProcess::processWithPid(5);
    ASSERT_NE(daemon, nullptr);
    EXPECT_FALSE(daemon->is64bit());

    auto kernel = VSProcess::processWithPid(0);
    ASSERT_NE(kernel, nullptr);
    EXPECT_NE(dynamic_cast<VSKernelProcess *>(kernel.get()), nullptr);
    EXPECT_EQ(kernel->displayString(), "kernel [0]");
    EXPECT_EQ(kernel->idleExitStatus(), VSIdleExitUnsupported);
    kernel->gatherData();
    EXPECT_TRUE(kernel->errors().empty());

    // A kernel-flagged record is a kernel target whatever its pid; targets
    // are equal by pid alone.
    VSBsdInfo record = fake.process(5).record().bsdInfo;
    record.flags |= vs::kBsdInfoFlagSystem;
    auto sameAsDaemon = VSProcess::processWithBsdInfo(record);
    ASSERT_NE(sameAsDaemon, nullptr);
    EXPECT_NE(dynamic_cast<VSKernelProcess *>(sameAsDaemon.get()), nullptr);
    EXPECT_TRUE(sameAsDaemon->isEqual(*daemon));
    EXPECT_FALSE(init->isEqual(*daemon));
    EXPECT_EQ(daemon->hash(), 5u);

    EXPECT_EQ(VSProcess::processWithPid(77), nullptr);
    EXPECT_TRUE(VSProcess::globalErrors().empty());
}

TEST_F(ProcessTest, RefusedTaskLeavesAGlobalErrorAndNoTarget) {
    fake.errorText(5, "permission refused");
    fake.process(42, "locked").refuseTaskHandle(5);
    EXPECT_TRUE(VSProcess::globalErrors().empty());

    EXPECT_EQ(VSProcess::processWithPid(42), nullptr);
    EXPECT_EQ(VSProcess::globalErrors(), std::vector<std::string>{"task_handle_for_pid [42] permission refused"});
    ASSERT_EQ(fake.reportedErrors().size(), 1u);
    EXPECT_EQ(fake.reportedErrors()[0].first, "task_handle_for_pid");
    EXPECT_EQ(fake.reportedErrors()[0].second, 5);
}

TEST_F(ProcessTest, DescriptionsResolveByNameFirstThenByNumber) {
    fake.process(1, "init");
    fake.process(5, "123");
    fake.process(123, "worker");
    fake.process(42, "server");
    fake.process(43, "server");
    fake.process(50, "-7");

    struct Case {
        std::vector<std::string> descriptions;
        VSPidTable expected;
        std::vector<std::string> errors;
    };
    const std::vector<Case> cases = {
        {{"worker"}, {{123, "worker"}}, {}},
        {{"123"}, {{5, "123"}}, {}},  // a name listed earlier beats the pid
        {{" 42"}, {{42, std::nullopt}}, {}},
        {{"+42"}, {{42, std::nullopt}}, {}},
        {{"42abc"}, {{42, std::nullopt}}, {}},
        {{"x42"}, {}, {"Unable to find pid for process matching 'x42'"}},
        {{"-42"}, {}, {"Unable to find pid for process matching '-42'"}},
        {{"-7"}, {{50, "-7"}}, {}},
        {{"work"}, {}, {"Unable to find pid for process matching 'work'"}},
        {{"server"}, {{42, "server"}}, {}},  // the first of two with that name
        {{"init", "1"}, {{1, std::nullopt}}, {}},
        {{"1", "init"}, {{1, "init"}}, {}},
        {{"nope", "worker", ""},
         {{123, "worker"}},
         {"Unable to find pid for process matching 'nope'", "Unable to find pid for process matching ''"}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.descriptions));
        std::vector<std::string> errors = {"stale"};
        auto resolved = VSProcess::pidsForStringDescriptions(c.descriptions, &errors);
        ASSERT_TRUE(resolved.has_value());
        EXPECT_EQ(*resolved, c.expected);
        EXPECT_EQ(errors, c.errors);
        // Without an error list, unmatched descriptions are dropped quietly.
        EXPECT_EQ(VSProcess::pidsForStringDescriptions(c.descriptions), c.expected);
    }
}

TEST_F(ProcessTest, NoProcessListMeansNoAnswer) {
    fake.process(1, "init");
    fake.failAlways(VSFakeQuery::ListAllPids, -1);
    std::vector<std::string> errors;
    EXPECT_FALSE(VSProcess::pidsForStringDescriptions({"init"}, &errors).has_value());
    EXPECT_EQ(errors, std::vector<std::string>{"Unable to obtain system process list"});
    EXPECT_FALSE(VSProcess::childPidsForPids({1}).has_value());
    EXPECT_FALSE(VSProcess::allProcessesExcludingPids({}).has_value());
}

TEST_F(ProcessTest, ChildrenAreCollectedLevelByLevel) {
    fake.kernelProcess();
    fake.process(1, "init").parent(0);
    fake.process(10, "a").parent(1);
    fake.process(11, "b").parent(1);
    fake.process(20, "c").parent(10);
    fake.process(30, "d").parent(20);
    fake.process(12, "e").parent(1).exited();  // not listed any more

    struct Case {
        std::vector<int32_t> given;
        std::vector<int32_t> expected;
    };
    const std::vector<Case> cases = {
        {{30}, {30}},
        {{}, {}},
        {{20}, {20, 30}},
        {{1}, {1, 10, 11, 20, 30}},
        {{10, 20}, {10, 20, 30}},
        {{30, 20}, {30, 20}},
        {{999}, {999}},
        // The kernel is its own parent; the walk still ends.
        {{0}, {0, 1, 10, 11, 20, 30}},
        {{0, 0}, {0, 0, 1, 10, 11, 20, 30}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.given));
        EXPECT_EQ(VSProcess::childPidsForPids(c.given), c.expected);
    }
}

TEST_F(ProcessTest, AllProcessesLeavesOutTheExcludedAndTheUnopenable) {
    fake.kernelProcess();
    fake.process(1, "init");
    fake.process(20, "self");
    fake.process(30, "locked").refuseTaskHandle(5);
    fake.process(40, "worker");

    auto targets = VSProcess::allProcessesExcludingPids({20});
    ASSERT_TRUE(targets.has_value());
    std::vector<int64_t> keys;
    for (const auto &[pid, target] : *targets) {
        keys.push_back(pid);
        EXPECT_EQ(target->pid(), pid);
    }
    EXPECT_EQ(keys, (std::vector<int64_t>{0, 1, 40}));
    EXPECT_NE(dynamic_cast<VSKernelProcess *>(targets->at(0).get()), nullptr);
    EXPECT_EQ(VSProcess::globalErrors().size(), 1u);
}

TEST_F(ProcessTest, IdleExitStateFollowsTheDirtyFlagsAndOnlyCleanTargetsAreDropped) {
    struct Case {
        uint32_t flags;
        int32_t status;
    };
    const std::vector<Case> cases = {
        {0x0, VSIdleExitUnsupported}, {0x1, VSIdleExitUnsupported}, {0x2, VSIdleExitUnsupported},
        {0x4, VSIdleExitUnsupported}, {0x3, VSIdleExitClean},       {0xB, VSIdleExitClean},
        {0x7, VSIdleExitDirty},
    };
    VSTargetMap targets;
    int32_t pid = 100;
    for (const Case &c : cases) {
        fake.process(++pid, "p").dirtyFlags(c.flags);
        auto target = VSProcess::processWithPid(pid);
        ASSERT_NE(target, nullptr);
        EXPECT_EQ(target->idleExitStatus(), c.status) << "flags " << c.flags;
        targets[pid] = std::move(target);
    }
    // A failed query leaves the flags 0.
    fake.process(200, "p").dirtyFlags(0x3).failAlways(VSFakeQuery::PidDirtyFlags, 3);
    targets[200] = VSProcess::processWithPid(200);
    EXPECT_EQ(targets[200]->idleExitStatus(), VSIdleExitUnsupported);
    // Status 0 (never determined) is kept too.
    targets[300] = BareTarget::make(300);
    ASSERT_NE(targets[300], nullptr);
    EXPECT_EQ(targets[300]->idleExitStatus(), VSIdleExitUnknown);

    VSTargetMap kept = VSProcess::removeIdleExitCleanProcessesFrom(std::move(targets));
    std::vector<int64_t> keys;
    for (const auto &[key, target] : kept) {
        keys.push_back(key);
    }
    EXPECT_EQ(keys, (std::vector<int64_t>{101, 102, 103, 104, 107, 200, 300}));
}

TEST_F(ProcessTest, AuxiliaryDataReportsTheCountersTakenAtConstruction) {
    struct Case {
        const char *what;
        std::function<void(VSFakeProcessBuilder &)> script;
        nlohmann::json expected;
    };
    const std::vector<Case> cases = {
        {"all counters",
         [](VSFakeProcessBuilder &p) { p.resourceUsage(4096, 8192).kernelMemory(100, 40, 30, 10); },
         {{"phys_vestage", 4096},
          {"phys_vestage_peak", 8192},
          {"Kernel memory", {{"KPRVT", 60}, {"KSHRD", 20}}}}},
        {"resource usage unreadable",
         [](VSFakeProcessBuilder &p) {
             p.resourceUsage(4096, 8192).kernelMemory(100, 40, 30, 10).failAlways(VSFakeQuery::PidResourceUsage, 1);
         },
         {{"Kernel memory", {{"KPRVT", 60}, {"KSHRD", 20}}}}},
        {"a counter running backwards",
         [](VSFakeProcessBuilder &p) { p.kernelMemory(10, 16, 0, 0); },
         {{"Kernel memory", {{"KPRVT", -6}, {"KSHRD", 0}}}}},
        {"kernel memory unreadable",
         [](VSFakeProcessBuilder &p) {
             p.kernelMemory(10, 4, 0, 0).failAlways(VSFakeQuery::TaskMemoryInfo, vs::kReturnInvalidArgument);
         },
         {{"Kernel memory", {{"KPRVT", 0}, {"KSHRD", 0}}}}},
    };
    int32_t pid = 100;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        auto builder = fake.process(++pid, "p");
        c.script(builder);
        auto target = VSProcess::processWithPid(pid);
        ASSERT_NE(target, nullptr);
        auto aux = target->auxData();
        ASSERT_NE(aux, nullptr);
        EXPECT_EQ(aux->jsonRepresentation(), c.expected);
    }

    // A target that is not alive reports nothing at all.
    fake.process(300, "gone").resourceUsage(4096, 8192);
    auto notAlive = vs::testing::NotAliveProcess::make(300);
    ASSERT_NE(notAlive, nullptr);
    EXPECT_EQ(notAlive->phys_vestage(), 0u);
    EXPECT_EQ(notAlive->auxData(), nullptr);
}

TEST_F(ProcessTest, BreakdownSwitchIsReadFromTheKernelSetting) {
    fake.process(1, "init");
    auto target = VSProcess::processWithPid(1);
    ASSERT_NE(target, nullptr);

    EXPECT_FALSE(target->breakDownPhysVestage());  // no such setting
    fake.setting("vm.self_region_vestage", 1);
    EXPECT_TRUE(target->breakDownPhysVestage());
    fake.setting("vm.self_region_vestage", 0);
    EXPECT_FALSE(target->breakDownPhysVestage());

    fake.setting("vm.self_region_vestage", 1);
    fake.failAlways(VSFakeQuery::SysctlByNameRead, 1);  // EPERM
    ::testing::internal::CaptureStderr();
    EXPECT_FALSE(target->breakDownPhysVestage());
    EXPECT_EQ(::testing::internal::GetCapturedStderr(),
              "Unable to retrieve status of physical vestage data collection: Operation not permitted\n");
}

}  // namespace
