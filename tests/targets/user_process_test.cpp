// The live-process walk: record rules, cutting the shared cache region along images, stopping rules and failures;
// and the crash-snapshot target, which takes its identity from the launcher and never asks what only the living answer.

#include <gtest/gtest.h>

#include <functional>

#include "targets/corpse_process.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::userProcess;

constexpr uint64_t P = 4096;
constexpr uint64_t S = 0x180000000;  // the shared cache region of the scripted 64-bit platform
constexpr int32_t kDirty = 0x9, kCleanFile = 0x81, kSwapped = 0x10, kAnonymous = 0x1;

// One region as text: "start-end name dirty swapped", with " unused" for an unused shared cache area.
using RegionFacts = std::string;
RegionFacts facts(uint64_t start, uint64_t end, const std::string &name, uint64_t dirty, uint64_t swapped,
                  bool unused) {
    char bounds[48];
    std::snprintf(bounds, sizeof bounds, "%#llx-%#llx ", static_cast<unsigned long long>(start),
                  static_cast<unsigned long long>(end));
    return bounds + name + " " + std::to_string(dirty) + " " + std::to_string(swapped) + (unused ? " unused" : "");
}
RegionFacts unused(uint64_t start, uint64_t end, uint64_t dirty = 0, uint64_t swapped = 0) {
    return facts(start, end, "unused rtloader shared cache area", dirty, swapped, true);
}
RegionFacts piece(uint64_t start, uint64_t end, uint64_t dirty = 0, uint64_t swapped = 0, std::string kind = "__DATA") {
    return facts(start, end, kind + " /test/lib/a", dirty, swapped, false);
}

std::vector<RegionFacts> factsOf(const VSProcess &process, uint64_t from = 0) {
    std::vector<RegionFacts> out;
    for (const auto &r : process.memoryRegions()) {
        if (r->start() >= from) {
            out.push_back(facts(r->start(), r->end(), r->name().value_or("<none>"), r->dirtySize(), r->swappedSize(),
                                r->unusedSharedCacheRegion()));
        }
    }
    return out;
}

using Segment = std::tuple<std::string, uint64_t, uint64_t>;  // name, start, length
Segment data(uint64_t start, uint64_t length) { return {"__DATA", start, length}; }
Segment text(uint64_t start, uint64_t length) { return {"__TEXT", start, length}; }
using Pages = std::vector<std::pair<uint64_t, int32_t>>;

class UserProcessTest : public vs::testing::TargetTest {
protected:
    // A 64-bit process with one region below a 64 KiB shared cache range cut by /test/lib/a.
    std::unique_ptr<VSUserProcess> cacheProcess(int32_t pid, const std::vector<Segment> &segments, const Pages &pages) {
        auto p = fake.process(pid, "w");
        p.region(0x100000000, 0x4000).tag(1).resident(1);
        p.region(S, 0x10000).wired(1);
        auto image = p.image("/test/lib/a");
        for (const auto &[name, start, length] : segments) {
            image.segment(name, start, length);
        }
        for (const auto &[address, word] : pages) {
            p.pages(address, {word});
        }
        return userProcess(pid, true);
    }
};

TEST_F(UserProcessTest, RecordRulesClassifyPagesByPurgeableStateAndBacking) {
    struct Case {
        const char *what;
        uint32_t resident, reusable, dirtied, swapped;
        bool file, breakDown;
        std::optional<int32_t> purgeable;
        uint64_t dirty, reclaimable, clean, swappedBytes;
    };
    const std::vector<Case> cases = {
        {"anonymous: resident but not reusable is dirty", 10, 2, 0, 0, false, false, {}, 8 * P, 2 * P, 0, 0},
        {"anonymous in breakdown mode keeps the dirtied count", 10, 2, 0, 0, false, true, {}, 0, 2 * P, 8 * P, 0},
        {"a file keeps the dirtied count", 10, 0, 3, 0, true, false, {}, 3 * P, 0, 7 * P, 0},
        {"non-volatile purgeable", 10, 2, 0, 4, false, false, VSPurgeableNonVolatile, 8 * P, 2 * P, 0, 4 * P},
        {"volatile purgeable is only reclaimable", 5, 1, 3, 2, false, false, VSPurgeableVolatile, 0, 5 * P, 0, 0},
        {"empty purgeable: all reclaimable", 5, 1, 3, 2, false, false, VSPurgeableEmpty, 0, 16 * P, 0, 0},
        {"dirtied and reusable beyond resident: clean stays 0", 2, 1, 3, 0, true, false, {}, 3 * P, P, 0, 0},
        {"reusable beyond resident: dirty stays 0", 1, 3, 0, 0, false, false, {}, 0, 3 * P, 0, 0},
        {"swapped pages", 4, 0, 1, 6, true, false, {}, P, 0, 3 * P, 6 * P},
    };
    fake.platformCodeForAll(VSPlatformNone);
    int32_t pid = 100;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        fake.setting("vm.self_region_vestage", c.breakDown ? 1 : 0);
        auto region = fake.process(++pid, "p").region(0x10000, 16 * P).tag(1).wired(3).resident(c.resident);
        region.reusable(c.reusable).dirtied(c.dirtied).swappedOut(c.swapped).external(c.file);
        if (c.purgeable) {
            region.purgeable(*c.purgeable);
        }
        auto process = userProcess(pid, true);
        const VSMemoryRegion &r = *process->memoryRegions().at(0);
        EXPECT_EQ(std::tuple(r.dirtySize(), r.reclaimableSize(), r.cleanNonSpecSize(), r.swappedSize(), r.wiredSize()),
                  std::tuple(c.dirty, c.reclaimable, c.clean, c.swappedBytes, 3 * P));
    }
}

TEST_F(UserProcessTest, SharedCacheIsCutAlongImagesAndBoundaryPagesAreSplitBetweenNeighbours) {
    struct Case {
        const char *what;
        std::vector<Segment> segments;
        Pages pages;
        std::vector<RegionFacts> expected;
        std::vector<uint64_t> queried = {};  // page query addresses, when they matter
    };
    const std::vector<Segment> apart = {data(S, 0x1000), data(S + 0x2800, 0x1800)};
    const RegionFacts rest = unused(S + 0x4000, S + 0x10000);
    const std::vector<Case> cases = {
        {"no image segments: one unused area", {}, {}, {unused(S, S + 0x10000)}},
        {"two images with a gap between", {data(S, 0x3000), data(S + 0x5000, 0x1000)},
         {{S, kDirty}, {S + 0x1000, kCleanFile}, {S + 0x2000, kSwapped}, {S + 0x3000, kDirty}, {S + 0x5000, kDirty}},
         {piece(S, S + 0x3000, P, P), unused(S + 0x3000, S + 0x5000), piece(S + 0x5000, S + 0x6000, P),
          unused(S + 0x6000, S + 0x10000)}},
        {"a gap shorter than the alignment is absorbed", {data(S, 0x2800), data(S + 0x3000, 0x1000)},
         {{S + 0x2000, kDirty}}, {piece(S, S + 0x3000, P), piece(S + 0x3000, S + 0x4000), rest}},
        {"no absorption after a piece that starts off the alignment",
         {data(S + 0x800, 0x2000), data(S + 0x3000, 0x1000)}, {},
         {unused(S, S + 0x800), piece(S + 0x800, S + 0x2800), unused(S + 0x2800, S + 0x3000),
          piece(S + 0x3000, S + 0x4000), rest}},
        {"the last image is padded to the alignment", {data(S + 0xE000, 0x1800)}, {},
         {unused(S, S + 0xE000), piece(S + 0xE000, S + 0x10000)}},
        {"an image beyond the end of the range is cut there", {data(S + 0xF000, 0x3000)}, {{S + 0xF000, kAnonymous}},
         {unused(S, S + 0xF000), piece(S + 0xF000, S + 0x10000, P)}},
        {"text and link-edit pieces are never classified", {text(S, 0x1000), {"__LINKEDIT", S + 0x1000, 0xF000}},
         {{S, kDirty}, {S + 0x1000, kDirty}},
         {piece(S, S + 0x1000, 0, 0, "__TEXT"),
          facts(S + 0x1000, S + 0x10000, "__LINKEDIT rtloader shared cache", 0, 0, false)}},
        {"a piece inside one page takes its own bytes and leaves the rest to the next area",
         {data(S + 0x100, 0x200)}, {{S, kDirty}},
         {unused(S, S + 0x100), piece(S + 0x100, S + 0x300, 0x200), unused(S + 0x300, S + 0x10000, 0xD00)}, {S}},
        {"two pieces meeting inside a dirty page", {data(S, 0x1800), data(S + 0x1800, 0x1800)},
         {{S, kDirty}, {S + 0x1000, kDirty}, {S + 0x2000, kDirty}},
         {piece(S, S + 0x1800, 0x1800), piece(S + 0x1800, S + 0x3000, 0x1800), unused(S + 0x3000, S + 0x10000)},
         {S, S + 0x2000}},
        {"an unused area ending inside a page the next piece finds swapped", apart, {{S + 0x2000, kSwapped}},
         {piece(S, S + 0x1000), unused(S + 0x1000, S + 0x2800, 0, 0x800), piece(S + 0x2800, S + 0x4000, 0, 0x800),
          rest},
         {S, S + 0x2000}},
        {"... or dirty", apart, {{S + 0x2000, kDirty}, {S + 0x3000, kDirty}},
         {piece(S, S + 0x1000), unused(S + 0x1000, S + 0x2800, 0x800), piece(S + 0x2800, S + 0x4000, 0x1800), rest}},
        {"... or clean: the area gets nothing", apart, {{S + 0x2000, kCleanFile}},
         {piece(S, S + 0x1000), unused(S + 0x1000, S + 0x2800), piece(S + 0x2800, S + 0x4000), rest}},
        {"a text piece between: the area gets only its own bytes of the page",
         {data(S, 0x1000), text(S + 0x2400, 0x400), data(S + 0x2800, 0x1800)}, {{S + 0x2000, kDirty}},
         {piece(S, S + 0x1000), unused(S + 0x1000, S + 0x2400, 0x400), piece(S + 0x2400, S + 0x2800, 0, 0, "__TEXT"),
          piece(S + 0x2800, S + 0x4000, 0x800), rest}},
        {"a text piece filling the area's last page: that page is never credited to the area",
         {data(S, 0x800), text(S + 0x1800, 0x1000), data(S + 0x2800, 0x1800)},
         {{S, kDirty}, {S + 0x1000, kDirty}, {S + 0x2000, kDirty}},
         {piece(S, S + 0x800, 0x800), unused(S + 0x800, S + 0x1800, 0x800),
          piece(S + 0x1800, S + 0x2800, 0, 0, "__TEXT"), piece(S + 0x2800, S + 0x4000, 0x800), rest},
         {S, S + 0x2000}},
    };
    int32_t pid = 100;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        auto process = cacheProcess(++pid, c.segments, c.pages);
        EXPECT_EQ(factsOf(*process, S), c.expected);
        EXPECT_TRUE(process->errors().empty());
        for (const auto &r : process->memoryRegions()) {  // one wired page at most, never more than the dirty bytes
            const uint64_t wired = r->unusedSharedCacheRegion() ? 0 : std::min(P, r->dirtySize());
            EXPECT_TRUE(r->start() < S || (r->offset() == r->start() - S && r->wiredSize() == wired)) << r->start();
        }
        std::vector<uint64_t> queried;
        for (const VSFakeCall &call : fake.calls(VSFakeQuery::PageRangeQuery)) {
            if (call.pid == pid && !c.queried.empty()) {
                queried.push_back(call.address);
            }
        }
        EXPECT_EQ(queried, c.queried);  // each boundary page once
    }
}

TEST_F(UserProcessTest, WalkStopsAfterTheAllOnesTagRun) {
    fake.platformCodeForAll(VSPlatformNone);
    uint64_t address = 0;
    for (uint32_t tag : {1u, ~0u, ~0u, 2u, ~0u}) {
        fake.process(42, "w").region(address += 0x10000, 0x1000).tag(tag);
    }
    auto process = userProcess(42, true);
    const RegionFacts last = facts(0x30000, 0x31000, "Non-volatile physical vestage", 0, 0, false);
    EXPECT_EQ(factsOf(*process, 0x30000), std::vector{last});  // the run's last region, then nothing
    EXPECT_TRUE(process->errors().empty() && process->warnings().empty());
}

// A failure ends the walk with what was found so far; it is excused as a warning only when a live process went away.
TEST_F(UserProcessTest, FailuresDuringTheWalkBecomeWarningsOnlyForAProcessThatWentAway) {
    using Q = VSFakeQuery;
    enum Kind { Live, NotAlive, Corpse };
    struct Case {
        std::function<void(VSFakeProcessBuilder &)> script;
        Kind kind;
        std::string warning, error, label = "region_recurse";
        size_t regionsKept = 2;
    };
    const std::string gone = "w [42]: message to a dead port", corpseGone = "w [42] (corpse): message to a dead port";
    const auto pageQueryFails = [](VSFakeProcessBuilder &p) {
        p.region(S, 0x10000);
        p.image("/test/lib/a").segment("__DATA", S, 0x1000).segment("__DATA", S + 0x2000, 0x1000);
        p.exitsAt(Q::PageRangeQuery, 2);
    };
    const std::vector<Case> cases = {
        {[](auto &p) { p.exitsAt(Q::RegionRecurse, 3); }, Live, gone + " (process exited)", ""},
        {[](auto &p) { p.becomesZombieAt(Q::RegionRecurse, 3); }, Live, gone + " (zombie)", ""},
        {[](auto &p) { p.failOnCall(Q::RegionRecurse, 3, vs::kReturnDeadPort); }, Live, "", gone},  // still running
        {[](auto &p) { p.exitsAt(Q::RegionRecurse, 3).failOnCall(Q::RegionRecurse, 3, 6); }, Live, "",
         "w [42]: error 0x6"},
        {pageQueryFails, Live, "w [42]: invalid argument (process exited)", "", "page_range_query", 5},
        {[](auto &p) { p.exitsAt(Q::RegionRecurse, 3); }, NotAlive, "", gone},
        {[](auto &p) { p.corpse().exitsAt(Q::RegionRecurse, 3); }, Corpse, "", corpseGone},
        {[](auto &p) { p.corpse().becomesZombieAt(Q::RegionRecurse, 3); }, Corpse, "", corpseGone},
        {[&](auto &p) { pageQueryFails(p.corpse()); }, Corpse, "", "w [42] (corpse): invalid argument",
         "page_range_query", 5},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.warning + c.error);
        VSFakePlatform local;
        local.errorStream(nullptr);
        auto installed = local.install();
        auto p = local.process(42, "w");
        for (uint32_t tag : {1, 2, 3}) {
            p.region(tag * 0x10000, 0x1000).tag(tag);
        }
        c.script(p);
        std::unique_ptr<VSUserProcess> process;
        if (c.kind == Corpse) {
            process = vs::testing::as<VSCorpseProcess>(
                VSCorpseProcess::processWithCorpse(VSFakePlatform::handleFor(42), 42, "w", 0, 0x4));
        } else {
            process = c.kind == Live ? userProcess(42) : vs::testing::NotAliveProcess::make(42);
        }
        ::testing::internal::CaptureStderr();
        process->gatherData();
        EXPECT_EQ(::testing::internal::GetCapturedStderr(),
                  "bailing out for process " + process->displayString() + "; data may be incomplete!\n");
        EXPECT_EQ(process->warnings(), c.warning.empty() ? std::vector<std::string>{} : std::vector{c.warning});
        EXPECT_EQ(process->errors(), c.error.empty() ? std::vector<std::string>{} : std::vector{c.error});
        EXPECT_EQ(process->memoryRegions().size(), c.regionsKept);
        ASSERT_EQ(local.reportedErrors().size(), 1u);
        EXPECT_EQ(local.reportedErrors()[0].first, c.label);
        EXPECT_TRUE(c.kind != Corpse || local.callCount(Q::PidShortInfo) == 0);  // never asked whether it still runs
    }
}

// ---- crash snapshots ----

class CorpseProcessTest : public vs::testing::TargetTest {};

TEST_F(CorpseProcessTest, ProcessFlagsBecomeRecordFlagsBitByBit) {
    for (const auto &[procFlags, recordFlags] : std::vector<std::pair<uint32_t, uint32_t>>{
             {0x0, 0x0}, {0x4, 0x10}, {0x200, 0x1}, {0x2, 0x80}, {0x1000000, 0x100}, {0x100, 0x2000}, {0x4000, 0x4000},
             {0x1 | 0x8 | 0x10 | 0x80 | 0x2000 | 0x80000000, 0x0},  // others dropped, record bits among them
             {0xFFFFFFFF, 0x10 | 0x1 | 0x80 | 0x100 | 0x2000 | 0x4000}}) {
        EXPECT_EQ(VSCorpseProcess::bsdInfoFlagsForProcFlags(procFlags), recordFlags) << procFlags;
    }
}

TEST_F(CorpseProcessTest, NothingIsAskedThatNeedsARunningProcess) {
    // A running process under the same pid with live state of its own: asking would get an answer.
    auto p = fake.process(42, "bystander").is64bit(false).dirtyFlags(0x7).resourceUsage(1 << 20, 2 << 20);
    p.platformCode(VSPlatformNone).region(0x10000, 0x4000).file("/data/mapped.db").resident(2);
    // Launcher values: 64-bit; of the idle-exit flags only the low 32 bits count (tracked, allowed: clean).
    auto target = vs::testing::as<VSCorpseProcess>(
        VSCorpseProcess::processWithCorpse(VSFakePlatform::handleFor(42), 42, "crashy", 0x100000003, 0x4));
    target->gatherData();
    EXPECT_EQ(target->displayString(), "crashy [42] (corpse)");
    EXPECT_EQ(std::tuple(target->is64bit(), target->idleExitStatus(), target->_isAlive(), target->phys_vestage()),
              std::tuple(true, VSIdleExitClean, false, 0u));
    EXPECT_EQ(target->auxData(), nullptr);
    using Q = VSFakeQuery;
    for (Q query : {Q::PidBsdInfo, Q::PidDirtyFlags, Q::TaskHandleForPid, Q::PidResourceUsage, Q::PidShortInfo}) {
        EXPECT_EQ(fake.callCount(query), 0u) << static_cast<int>(query);
    }
    EXPECT_EQ(target->memoryRegions().at(0)->detailedName(), std::nullopt);  // a file's path is asked of the living
    target.reset();  // the handle belongs to this program: the corpse gives nothing back
    EXPECT_EQ(fake.callCount(Q::ReleaseTaskHandle) + fake.callCount(Q::PidRegionFilename), 0u);
}

}  // namespace
