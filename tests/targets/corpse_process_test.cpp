// The crash-snapshot target on the scripted platform: what it takes from the
// launcher instead of the process table, what it never asks of a process
// that no longer runs, and that its memory is otherwise read exactly like a
// live process's.

#include <gtest/gtest.h>

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "targets/corpse_process.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::TargetTest;
using vs::testing::userProcess;

constexpr uint64_t P = 4096;
constexpr uint64_t kSharedCacheBase = 0x180000000;  // of the scripted 64-bit platform

std::unique_ptr<VSCorpseProcess> corpseFor(uint32_t port, int32_t pid, const std::string &name,
                                           uint64_t dirtyFlags = 0, uint64_t procFlags = 0x4) {
    std::unique_ptr<VSProcess> process = VSCorpseProcess::processWithCorpse(port, pid, name, dirtyFlags, procFlags);
    auto *corpse = dynamic_cast<VSCorpseProcess *>(process.get());
    if (corpse == nullptr) {
        return nullptr;
    }
    process.release();
    return std::unique_ptr<VSCorpseProcess>(corpse);
}

struct RegionFacts {
    uint64_t start = 0;
    uint64_t end = 0;
    std::string name;
    std::optional<std::string> detailedName;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;

    bool operator==(const RegionFacts &) const = default;
};

void PrintTo(const RegionFacts &r, std::ostream *os) {
    *os << std::hex << "[0x" << r.start << ", 0x" << r.end << ") " << r.name << " (" << r.detailedName.value_or("-")
        << ")" << std::dec << " dirty " << r.dirty << " swapped " << r.swapped << " clean " << r.clean
        << " reclaimable " << r.reclaimable << " wired " << r.wired;
}

std::vector<RegionFacts> factsOf(const VSProcess &process) {
    std::vector<RegionFacts> facts;
    for (const auto &region : process.memoryRegions()) {
        facts.push_back({region->start(), region->end(), region->name().value_or("<none>"), region->detailedName(),
                         region->dirtySize(), region->swappedSize(), region->cleanNonSpecSize(),
                         region->reclaimableSize(), region->wiredSize()});
    }
    return facts;
}

class CorpseProcessTest : public TargetTest {};

TEST_F(CorpseProcessTest, ProcessFlagsBecomeRecordFlagsBitByBit) {
    struct Case {
        uint32_t procFlags;
        uint32_t recordFlags;
    };
    const Case cases[] = {
        {0x0, 0x0},
        {0x4, 0x10},
        {0x200, 0x1},
        {0x2, 0x80},
        {0x1000000, 0x100},
        {0x100, 0x2000},
        {0x4000, 0x4000},
        {0x4 | 0x200 | 0x2 | 0x1000000 | 0x100 | 0x4000, 0x10 | 0x1 | 0x80 | 0x100 | 0x2000 | 0x4000},
        // Every other bit is dropped, including those that are record bits
        // themselves.
        {0x1 | 0x8 | 0x10 | 0x80 | 0x2000 | 0x80000000, 0x0},
        {0xFFFFFFFF, 0x10 | 0x1 | 0x80 | 0x100 | 0x2000 | 0x4000},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.procFlags);
        EXPECT_EQ(VSCorpseProcess::bsdInfoFlagsForProcFlags(c.procFlags), c.recordFlags);
    }
}

TEST_F(CorpseProcessTest, LauncherValuesDecideIdentityWidthAndIdleExitState) {
    struct Case {
        const char *what;
        uint64_t dirtyFlags;
        uint64_t procFlags;
        bool is64bit;
        uint64_t sharedBase;
        uint64_t sharedSize;
        int32_t idleExitStatus;
    };
    const Case cases[] = {
        {"64-bit process", 0, 0x4, true, 0x180000000, 0x100000000, VSIdleExitUnsupported},
        {"32-bit process", 0, 0x0, false, 0x1A000000, 0x26000000, VSIdleExitUnsupported},
        {"a system process that is 64-bit", 0, 0x204, true, 0x180000000, 0x100000000, VSIdleExitUnsupported},
        {"tracked, idle exit allowed, clean", 0x3, 0x4, true, 0x180000000, 0x100000000, VSIdleExitClean},
        {"tracked, idle exit allowed, dirty", 0x7, 0x4, true, 0x180000000, 0x100000000, VSIdleExitDirty},
        {"tracked only", 0x1, 0x4, true, 0x180000000, 0x100000000, VSIdleExitUnsupported},
        {"unnamed bits are ignored", 0xB, 0x4, true, 0x180000000, 0x100000000, VSIdleExitClean},
        // Only the low 32 bits of the launcher's values count.
        {"high bits of both values", 0x100000003, 0x100000000, false, 0x1A000000, 0x26000000, VSIdleExitClean},
    };
    // The process table holds another process under the corpse's pid, with
    // its own name, width and idle-exit state: none of them may leak into
    // the corpse.
    fake.process(42, "bystander").is64bit(false).dirtyFlags(0x7).executable("/usr/bin/bystander");
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        fake.clearCalls();
        auto corpse = corpseFor(VSFakePlatform::handleFor(42), 42, "crashy", c.dirtyFlags, c.procFlags);
        ASSERT_NE(corpse, nullptr);
        EXPECT_EQ(corpse->pid(), 42);
        EXPECT_EQ(corpse->name(), "crashy");
        EXPECT_EQ(corpse->displayString(), "crashy [42] (corpse)");
        EXPECT_EQ(corpse->is64bit(), c.is64bit);
        EXPECT_EQ(corpse->sharedRegionBase(), c.sharedBase);
        EXPECT_EQ(corpse->sharedRegionSize(), c.sharedSize);
        EXPECT_EQ(corpse->idleExitStatus(), c.idleExitStatus);
        EXPECT_EQ(corpse->pageSize(), 4096u);
        EXPECT_EQ(corpse->sharedRegionAlignmentSize(), 4096u);
        EXPECT_EQ(corpse->task(), VSFakePlatform::handleFor(42));
        EXPECT_FALSE(corpse->_isAlive());
        EXPECT_EQ(fake.callCount(VSFakeQuery::PidDirtyFlags), 0u);
        EXPECT_EQ(fake.callCount(VSFakeQuery::TaskHandleForPid), 0u);
    }
}

TEST_F(CorpseProcessTest, WithoutAHandleNoTargetIsMadeAndNothingIsSaid) {
    fake.process(42, "crashy").corpse();
    ::testing::internal::CaptureStderr();
    EXPECT_EQ(VSCorpseProcess::processWithCorpse(vs::kTaskHandleNone, 42, "crashy", 0, 0x4), nullptr);
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "");
    EXPECT_TRUE(VSProcess::globalErrors().empty());
    EXPECT_TRUE(fake.reportedErrors().empty());
    EXPECT_TRUE(fake.allCalls().empty());
}

TEST_F(CorpseProcessTest, NothingIsAskedThatNeedsARunningProcess) {
    // A running process with every kind of live state: if the corpse asked
    // for any of it, it would get an answer.
    auto p = fake.process(42, "bystander").dirtyFlags(0x7).resourceUsage(64 * P, 128 * P);
    p.kernelMemory(10 * P, 2 * P, 5 * P, 1 * P);
    p.region(0x10000, 4 * P).file("/data/mapped.db").resident(2);
    p.region(0x20000, 4 * P).tag(1).resident(4);
    fake.platformCodeForAll(VSPlatformNone);

    auto corpse = corpseFor(VSFakePlatform::handleFor(42), 42, "crashy");
    ASSERT_NE(corpse, nullptr);
    corpse->gatherData();
    EXPECT_EQ(fake.callCount(VSFakeQuery::PidResourceUsage), 0u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::PidRegionFilename), 0u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::PidDirtyFlags), 0u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::PidShortInfo), 0u);
    EXPECT_EQ(corpse->phys_vestage(), 0u);
    EXPECT_EQ(corpse->auxData(), nullptr);

    const auto facts = factsOf(*corpse);
    ASSERT_EQ(facts.size(), 2u);
    EXPECT_EQ(facts[0].name, "mapped file");
    EXPECT_EQ(facts[0].detailedName, std::nullopt);

    // The handle belongs to this program's task: the corpse gives nothing back.
    corpse.reset();
    EXPECT_EQ(fake.callCount(VSFakeQuery::ReleaseTaskHandle), 0u);
}

TEST_F(CorpseProcessTest, MemoryIsClassifiedLikeALiveProcesssSameMemory) {
    // Two processes with the same address space: one running, one a crash
    // snapshot reachable only through its handle.
    for (int32_t pid : {42, 77}) {
        auto p = fake.process(pid, "twin");
        if (pid == 77) {
            p.corpse();
        }
        p.region(0x10000, 16 * P).tag(1).wired(3).resident(10).reusable(2);
        p.region(0x30000, 8 * P).file("/usr/lib/libtwin.so").resident(5).dirtied(1);
        p.region(0x40000, 8 * P).tag(2).resident(6).swappedOut(2).purgeable(VSPurgeableVolatile);
        p.region(0x50000, 8 * P).file("/data/twin.db").resident(3).dirtied(3);
        p.region(kSharedCacheBase, 0x10000);
        p.pages(kSharedCacheBase, {0x9, 0x1, 0x10, 0x81, 0x89, 0x0, 0x9, 0x9});
        p.image("/usr/lib/libtwin.so").segment("__TEXT", 0x30000, 8 * P);
        p.image("/usr/lib/cached.so").segment("__DATA", kSharedCacheBase, 8 * P);
    }

    auto live = userProcess(42);
    ASSERT_NE(live, nullptr);
    live->gatherData();
    auto corpse = corpseFor(VSFakePlatform::handleFor(77), 77, "twin");
    ASSERT_NE(corpse, nullptr);
    corpse->gatherData();

    EXPECT_TRUE(corpse->errors().empty());
    EXPECT_TRUE(corpse->warnings().empty());
    std::vector<RegionFacts> expected = factsOf(*live);
    ASSERT_EQ(expected.size(), 6u);
    // The one difference: a mapped file's path is only asked of a live process.
    ASSERT_EQ(expected[3].name, "mapped file");
    EXPECT_EQ(expected[3].detailedName, "/data/twin.db");
    expected[3].detailedName.reset();
    EXPECT_EQ(factsOf(*corpse), expected);

    // And the figures are those of the rules, not merely equal to each other.
    const auto facts = factsOf(*corpse);
    EXPECT_EQ(facts[0], (RegionFacts{0x10000, 0x20000, "malloc metadata", std::nullopt, 8 * P, 0, 0,
                                     2 * P, 3 * P}));
    EXPECT_EQ(facts[1].name, "__TEXT /usr/lib/libtwin.so");
    EXPECT_EQ(facts[2].reclaimable, 6 * P);
    EXPECT_EQ(facts[2].dirty, 0u);
    // Shared cache piece: dirty, anonymous, dirty file, dirty, dirty pages;
    // one swapped page.
    EXPECT_EQ(facts[4].name, "__DATA /usr/lib/cached.so");
    EXPECT_EQ(facts[4].dirty, 5 * P);
    EXPECT_EQ(facts[4].swapped, P);
    EXPECT_EQ(facts[5].name, "unused rtloader shared cache area");
}

TEST_F(CorpseProcessTest, FailuresWhileReadingACorpseAreErrors) {
    struct Case {
        const char *what;
        std::function<void(VSFakeProcessBuilder &)> script;
        std::string label;
        std::string error;
        size_t regionsKept;
    };
    const std::vector<Case> cases = {
        {"the snapshot went away during the walk",
         [](VSFakeProcessBuilder &p) { p.exitsAt(VSFakeQuery::RegionRecurse, 2); }, "region_recurse",
         "crashy [77] (corpse): message to a dead port", 1},
        {"the snapshot turned into a zombie",
         [](VSFakeProcessBuilder &p) { p.becomesZombieAt(VSFakeQuery::RegionRecurse, 2); }, "region_recurse",
         "crashy [77] (corpse): message to a dead port", 1},
        {"a region query refused with another code",
         [](VSFakeProcessBuilder &p) { p.failOnCall(VSFakeQuery::RegionRecurse, 2, 0x6); }, "region_recurse",
         "crashy [77] (corpse): error 0x6", 1},
        {"a page query in the shared cache fails as for a gone process",
         [](VSFakeProcessBuilder &p) { p.exitsAt(VSFakeQuery::PageRangeQuery, 1); }, "page_range_query",
         "crashy [77] (corpse): invalid argument", 2},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSFakePlatform local;
        local.errorStream(nullptr);
        auto installed = local.install();
        auto p = local.process(77, "crashy").corpse();
        p.region(0x10000, P).tag(1).resident(1);
        p.region(0x20000, P).tag(2).resident(1);
        p.region(kSharedCacheBase, 0x4000);
        p.image("/usr/lib/cached.so").segment("__DATA", kSharedCacheBase, 0x4000);
        c.script(p);

        auto corpse = corpseFor(VSFakePlatform::handleFor(77), 77, "crashy");
        ASSERT_NE(corpse, nullptr);
        ::testing::internal::CaptureStderr();
        corpse->gatherData();
        EXPECT_EQ(::testing::internal::GetCapturedStderr(),
                  "bailing out for process crashy [77] (corpse); data may be incomplete!\n");
        EXPECT_EQ(corpse->errors(), std::vector<std::string>{c.error});
        EXPECT_TRUE(corpse->warnings().empty());
        // A corpse is never asked whether it still runs.
        EXPECT_EQ(local.callCount(VSFakeQuery::PidShortInfo), 0u);
        ASSERT_EQ(local.reportedErrors().size(), 1u);
        EXPECT_EQ(local.reportedErrors()[0].first, c.label);
        EXPECT_EQ(corpse->memoryRegions().size(), c.regionsKept);
    }
}

}  // namespace
