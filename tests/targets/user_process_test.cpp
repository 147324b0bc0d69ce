// The live-process walk on the scripted platform: record rules and naming of
// ordinary regions, the cutting of the shared cache region along images
// with its boundary pages, the stopping rules and the failure path.

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::NotAliveProcess;
using vs::testing::TargetTest;
using vs::testing::userProcess;

constexpr uint64_t P = 4096;
constexpr uint64_t S = 0x180000000;  // the shared cache region of the scripted 64-bit platform
constexpr int32_t kDirty = 0x9;      // present and dirty
constexpr int32_t kCleanFile = 0x81;
constexpr int32_t kSwapped = 0x10;
constexpr int32_t kAnonymous = 0x1;  // present, not external: counts as dirty

const std::string kUnused = "unused rtloader shared cache area";

// The parts of a region the expectations name.
struct RegionFacts {
    uint64_t start = 0;
    uint64_t end = 0;
    std::string name;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    VSSegmentKind segment = VSSegmentUnknown;
    bool unused = false;

    bool operator==(const RegionFacts &) const = default;
};

void PrintTo(const RegionFacts &r, std::ostream *os) {
    *os << std::hex << "[0x" << r.start << ", 0x" << r.end << ") " << r.name << std::dec << " dirty " << r.dirty
        << " swapped " << r.swapped << " segment " << int(r.segment) << (r.unused ? " unused" : "");
}

std::vector<RegionFacts> factsOf(const VSProcess &process) {
    std::vector<RegionFacts> facts;
    for (const auto &region : process.memoryRegions()) {
        facts.push_back({region->start(), region->end(), region->name().value_or("<none>"), region->dirtySize(),
                         region->swappedSize(), region->segment(), region->unusedSharedCacheRegion()});
    }
    return facts;
}

class UserProcessTest : public TargetTest {
protected:
    // A 64-bit process with one region below the shared cache region and a
    // shared cache range of `sharedSize` bytes.
    VSFakeProcessBuilder sharedCacheProcess(uint64_t sharedSize = 0x10000) {
        auto p = fake.process(42, "w");
        p.region(0x100000000, 0x4000).tag(1).resident(1);
        p.region(S, sharedSize);
        return p;
    }

    std::unique_ptr<VSUserProcess> gathered(int32_t pid = 42) {
        auto process = userProcess(pid);
        if (process) {
            process->gatherData();
        }
        return process;
    }

    // The regions inside the shared cache region.
    static std::vector<RegionFacts> sharedCacheFacts(const VSProcess &process) {
        std::vector<RegionFacts> facts;
        for (const RegionFacts &f : factsOf(process)) {
            if (f.start >= S) {
                facts.push_back(f);
            }
        }
        return facts;
    }
};

// ---- regions outside the shared cache -----------------------------------------------------

TEST_F(UserProcessTest, RecordRulesClassifyPagesByPurgeableStateAndBacking) {
    struct Case {
        const char *what;
        uint32_t resident, reusable, dirtied, swapped;
        bool file;
        std::optional<int32_t> purgeable;
        bool breakDown;
        uint64_t dirty, reclaimable, clean, swappedBytes;
    };
    const uint64_t size = 16 * P;
    const std::vector<Case> cases = {
        {"anonymous: every resident page not reusable is dirty", 10, 2, 0, 0, false, std::nullopt, false, 8 * P,
         2 * P, 0, 0},
        {"anonymous in breakdown mode keeps the dirtied count", 10, 2, 0, 0, false, std::nullopt, true, 0, 2 * P,
         8 * P, 0},
        {"a file keeps the dirtied count", 10, 0, 3, 0, true, std::nullopt, false, 3 * P, 0, 7 * P, 0},
        {"non-volatile purgeable is classified like any region", 10, 2, 0, 4, false, VSPurgeableNonVolatile, false,
         8 * P, 2 * P, 0, 4 * P},
        {"volatile purgeable is only reclaimable", 5, 1, 3, 2, false, VSPurgeableVolatile, false, 0, 5 * P, 0, 0},
        {"empty purgeable: the whole region is reclaimable", 5, 1, 3, 2, false, VSPurgeableEmpty, false, 0, size, 0,
         0},
        {"dirtied and reusable beyond resident: clean stays 0", 2, 1, 3, 0, true, std::nullopt, false, 3 * P, P, 0,
         0},
        {"reusable beyond resident: dirty stays 0", 1, 3, 0, 0, false, std::nullopt, false, 0, 3 * P, 0, 0},
        {"swapped pages", 4, 0, 1, 6, true, std::nullopt, false, P, 0, 3 * P, 6 * P},
    };
    fake.platformCodeForAll(VSPlatformNone);
    int32_t pid = 100;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        fake.setting("vm.self_region_vestage", c.breakDown ? 1 : 0);
        auto p = fake.process(++pid, "p");
        auto region = p.region(0x10000, size).tag(1).wired(3).resident(c.resident).reusable(c.reusable);
        region.dirtied(c.dirtied).swappedOut(c.swapped).external(c.file);
        if (c.purgeable) {
            region.purgeable(*c.purgeable);
        }
        auto process = gathered(pid);
        ASSERT_NE(process, nullptr);
        ASSERT_EQ(process->memoryRegions().size(), 1u);
        const VSMemoryRegion &r = *process->memoryRegions()[0];
        EXPECT_EQ(r.dirtySize(), c.dirty);
        EXPECT_EQ(r.reclaimableSize(), c.reclaimable);
        EXPECT_EQ(r.cleanNonSpecSize(), c.clean);
        EXPECT_EQ(r.swappedSize(), c.swappedBytes);
        EXPECT_EQ(r.wiredSize(), 3 * P);  // not limited by any other size
        EXPECT_FALSE(r.inSharedCache());
    }
}

TEST_F(UserProcessTest, RegionsAreNamedByImageThenFileThenTag) {
    const uint32_t emptyNamedTag = vs::registerDynamicTagName("");
    fake.platformCodeForAll(VSPlatformNone);
    auto p = fake.process(42, "w");
    p.image("/test/lib/libz.so").segment("__DATA", 0x10000, 0x2000);
    p.region(0x10000, 0x2000).objectId(7).offset(0x3000).shareMode(vs::kShareModeCopyOnWrite);
    p.region(0x20000, 0x1000).file("/data/x");
    p.region(0x21000, 0x1000).external();  // no path to be had
    p.region(0x30000, 0x1000).tag(0);
    p.region(0x31000, 0x1000).tag(1);
    p.region(0x32000, 0x1000).tag(emptyNamedTag);
    p.region(0x33000, 0x1000).tag(emptyNamedTag).purgeable(VSPurgeableNonVolatile);
    p.region(0x34000, 0x1000).tag(1).purgeable(VSPurgeableNonVolatile);
    p.region(0x35000, 0x1000).tag(1).purgeable(VSPurgeableVolatile);

    struct Expected {
        std::string name;
        std::optional<std::string> detailedName;
        VSSegmentKind segment;
        bool purgeableNonVolatile;
    };
    const std::string untagged = "untagged (\"VM_ALLOCATE\")";
    const std::vector<Expected> plain = {
        {"__DATA /test/lib/libz.so", "/test/lib/libz.so", VSSegmentData, false},
        {"mapped file", "/data/x", VSSegmentNone, false},
        {"mapped file", std::nullopt, VSSegmentNone, false},
        {untagged, std::nullopt, VSSegmentNone, false},
        {"malloc metadata", std::nullopt, VSSegmentNone, false},
        {untagged, std::nullopt, VSSegmentNone, false},
        {untagged, std::nullopt, VSSegmentNone, false},
        {"malloc metadata", std::nullopt, VSSegmentNone, false},
        {"malloc metadata", std::nullopt, VSSegmentNone, false},
    };
    std::vector<Expected> brokenDown = plain;
    brokenDown[6] = {untagged + " (purgeable non-volatile)", std::nullopt, VSSegmentNone, true};
    brokenDown[7] = {"malloc metadata (purgeable non-volatile)", std::nullopt, VSSegmentNone, true};

    for (bool breakDown : {false, true}) {
        SCOPED_TRACE(breakDown ? "breakdown" : "no breakdown");
        fake.setting("vm.self_region_vestage", breakDown ? 1 : 0);
        auto process = gathered();
        ASSERT_NE(process, nullptr);
        const auto &expected = breakDown ? brokenDown : plain;
        ASSERT_EQ(process->memoryRegions().size(), expected.size());
        for (size_t i = 0; i < expected.size(); ++i) {
            const VSMemoryRegion &r = *process->memoryRegions()[i];
            EXPECT_EQ(r.name(), expected[i].name) << "region " << i;
            EXPECT_EQ(r.detailedName(), expected[i].detailedName) << "region " << i;
            EXPECT_EQ(r.segment(), expected[i].segment) << "region " << i;
            EXPECT_EQ(r.purgeableNonVolatile(), expected[i].purgeableNonVolatile) << "region " << i;
        }
        const VSMemoryRegion &first = *process->memoryRegions()[0];
        EXPECT_EQ(first.object_id(), 7u);
        EXPECT_EQ(first.offset(), 0x3000u);
        EXPECT_EQ(first.share_mode(), vs::kShareModeCopyOnWrite);
    }
    // Without a shared cache region the walk never asks the top-level map.
    EXPECT_EQ(fake.callCount(VSFakeQuery::RegionInfo), 0u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::PageRangeQuery), 0u);
}

TEST_F(UserProcessTest, ImagesAreSortedAndHeadersCountAsText) {
    fake.platformCodeForAll(VSPlatformNone);
    auto p = fake.process(42, "w");
    p.image("/test/lib/b.so").segment("__DATA_CONST rest", 0x30000, 0x1000).segment("__LINKEDIT", 0x40000, 0x1000);
    p.image("/test/lib/a.so")
        .segment(std::string(VSPlatform::image_header_segment_name), 0x10000, 0x1000)
        .segment("__OBJECTS", 0x20000, 0x1000)
        .segment("__DATA", 0x28000, 0);  // covers nothing
    auto process = gathered();
    ASSERT_NE(process, nullptr);

    struct Seen {
        uint64_t start;
        std::string name;
        VSSegmentKind segment;
        std::string owner;
        bool operator==(const Seen &) const = default;
    };
    std::vector<Seen> seen;
    for (const VSImage &image : process->images()) {
        seen.push_back({image.start(), image.name().value_or(""), image.segment(), image.ownerPath().value_or("")});
    }
    const std::vector<Seen> expected = {
        {0x10000, "__TEXT", VSSegmentText, "/test/lib/a.so"},
        {0x20000, "__OBJECTS", VSSegmentUnknown, "/test/lib/a.so"},
        {0x30000, "__DATA_CONST", VSSegmentData, "/test/lib/b.so"},
        {0x40000, "__LINKEDIT", VSSegmentLinkedit, "/test/lib/b.so"},
    };
    EXPECT_TRUE(seen == expected);
}

// ---- the shared cache region ----------------------------------------------------------------

struct Segment {
    std::string name;
    uint64_t start;
    uint64_t length;
};

TEST_F(UserProcessTest, SharedCacheIsCutAlongImages) {
    struct Case {
        const char *what;
        std::vector<Segment> segments;  // all of /test/lib/a
        std::vector<std::pair<uint64_t, int32_t>> pages;
        std::vector<RegionFacts> expected;
    };
    const std::string data = "__DATA /test/lib/a";
    const std::vector<Case> cases = {
        {"no images: one unused area", {}, {}, {{S, S + 0x10000, kUnused, 0, 0, VSSegmentUnknown, true}}},
        {"two images with a gap between",
         {{"__DATA", S, 0x3000}, {"__DATA", S + 0x5000, 0x1000}},
         {{S, kDirty}, {S + 0x1000, kCleanFile}, {S + 0x2000, kSwapped}, {S + 0x3000, kDirty}, {S + 0x5000, kDirty}},
         {{S, S + 0x3000, data, P, P, VSSegmentData, false},
          {S + 0x3000, S + 0x5000, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0x5000, S + 0x6000, data, P, 0, VSSegmentData, false},
          {S + 0x6000, S + 0x10000, kUnused, 0, 0, VSSegmentUnknown, true}}},
        {"a gap shorter than the alignment is absorbed",
         {{"__DATA", S, 0x2800}, {"__DATA", S + 0x3000, 0x1000}},
         {{S + 0x2000, kDirty}},
         {{S, S + 0x3000, data, P, 0, VSSegmentData, false},
          {S + 0x3000, S + 0x4000, data, 0, 0, VSSegmentData, false},
          {S + 0x4000, S + 0x10000, kUnused, 0, 0, VSSegmentUnknown, true}}},
        {"no absorption after a piece that starts off the alignment",
         {{"__DATA", S + 0x800, 0x2000}, {"__DATA", S + 0x3000, 0x1000}},
         {},
         {{S, S + 0x800, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0x800, S + 0x2800, data, 0, 0, VSSegmentData, false},
          {S + 0x2800, S + 0x3000, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0x3000, S + 0x4000, data, 0, 0, VSSegmentData, false},
          {S + 0x4000, S + 0x10000, kUnused, 0, 0, VSSegmentUnknown, true}}},
        {"the last image is padded to the alignment",
         {{"__DATA", S + 0xE000, 0x1800}},
         {},
         {{S, S + 0xE000, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0xE000, S + 0x10000, data, 0, 0, VSSegmentData, false}}},
        {"an image beyond the end of the range is cut there",
         {{"__DATA", S + 0xF000, 0x3000}},
         {{S + 0xF000, kAnonymous}},
         {{S, S + 0xF000, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0xF000, S + 0x10000, data, P, 0, VSSegmentData, false}}},
        {"text and link-edit pieces are never classified",
         {{"__TEXT", S, 0x1000}, {"__LINKEDIT", S + 0x1000, 0xF000}},
         {{S, kDirty}, {S + 0x1000, kDirty}},
         {{S, S + 0x1000, "__TEXT /test/lib/a", 0, 0, VSSegmentText, false},
          {S + 0x1000, S + 0x10000, "__LINKEDIT rtloader shared cache", 0, 0, VSSegmentLinkedit, false}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSFakePlatform local;
        local.errorStream(nullptr);
        auto installed = local.install();
        auto p = local.process(42, "w");
        p.region(0x100000000, 0x4000).tag(1).resident(1);
        p.region(S, 0x10000).wired(1);
        if (!c.segments.empty()) {
            auto image = p.image("/test/lib/a");
            for (const Segment &s : c.segments) {
                image.segment(s.name, s.start, s.length);
            }
        }
        for (const auto &[address, word] : c.pages) {
            p.pages(address, {word});
        }
        auto process = gathered();
        ASSERT_NE(process, nullptr);
        EXPECT_EQ(sharedCacheFacts(*process), c.expected);
        for (const auto &region : process->memoryRegions()) {
            if (region->start() >= S) {
                EXPECT_TRUE(region->inSharedCache());
                EXPECT_EQ(region->offset(), region->start() - S);
                // One wired page at most, never more than the piece's dirty bytes.
                EXPECT_EQ(region->wiredSize(), region->unusedSharedCacheRegion()
                                                   ? 0
                                                   : std::min<uint64_t>(P, region->dirtySize()));
            }
        }
        EXPECT_TRUE(process->errors().empty());
    }
}

TEST_F(UserProcessTest, BoundaryPagesAreSplitBetweenNeighboursAndQueriedOnce) {
    struct Case {
        const char *what;
        std::vector<Segment> segments;
        std::vector<std::pair<uint64_t, int32_t>> pages;
        std::vector<RegionFacts> expected;  // the first few regions of the range
        std::vector<uint64_t> queriedAddresses;
    };
    const std::string data = "__DATA /test/lib/a";
    const std::string text = "__TEXT /test/lib/a";
    const std::vector<Case> cases = {
        {"a piece inside one page takes its own bytes and leaves the rest to the next area",
         {{"__DATA", S + 0x100, 0x200}},
         {{S, kDirty}},
         {{S, S + 0x100, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0x100, S + 0x300, data, 0x200, 0, VSSegmentData, false},
          {S + 0x300, S + 0x10000, kUnused, 0xD00, 0, VSSegmentUnknown, true}},
         {S}},
        {"two pieces meeting inside a dirty page",
         {{"__DATA", S, 0x1800}, {"__DATA", S + 0x1800, 0x1800}},
         {{S, kDirty}, {S + 0x1000, kDirty}, {S + 0x2000, kDirty}},
         {{S, S + 0x1800, data, 0x1800, 0, VSSegmentData, false},
          {S + 0x1800, S + 0x3000, data, 0x1800, 0, VSSegmentData, false}},
         {S, S + 0x2000}},
        {"an unused area ending inside a page the next piece finds swapped",
         {{"__DATA", S, 0x1000}, {"__DATA", S + 0x2800, 0x1800}},
         {{S + 0x2000, kSwapped}},
         {{S, S + 0x1000, data, 0, 0, VSSegmentData, false},
          {S + 0x1000, S + 0x2800, kUnused, 0, 0x800, VSSegmentUnknown, true},
          {S + 0x2800, S + 0x4000, data, 0, 0x800, VSSegmentData, false}},
         {S, S + 0x2000}},
        {"... or dirty",
         {{"__DATA", S, 0x1000}, {"__DATA", S + 0x2800, 0x1800}},
         {{S + 0x2000, kDirty}, {S + 0x3000, kDirty}},
         {{S, S + 0x1000, data, 0, 0, VSSegmentData, false},
          {S + 0x1000, S + 0x2800, kUnused, 0x800, 0, VSSegmentUnknown, true},
          {S + 0x2800, S + 0x4000, data, 0x1800, 0, VSSegmentData, false}},
         {S, S + 0x2000}},
        {"... or clean: the area gets nothing",
         {{"__DATA", S, 0x1000}, {"__DATA", S + 0x2800, 0x1800}},
         {{S + 0x2000, kCleanFile}},
         {{S, S + 0x1000, data, 0, 0, VSSegmentData, false},
          {S + 0x1000, S + 0x2800, kUnused, 0, 0, VSSegmentUnknown, true},
          {S + 0x2800, S + 0x4000, data, 0, 0, VSSegmentData, false}},
         {S, S + 0x2000}},
        {"a text piece between: the area gets only its own bytes of the page",
         {{"__DATA", S, 0x1000}, {"__TEXT", S + 0x2400, 0x400}, {"__DATA", S + 0x2800, 0x1800}},
         {{S + 0x2000, kDirty}},
         {{S, S + 0x1000, data, 0, 0, VSSegmentData, false},
          {S + 0x1000, S + 0x2400, kUnused, 0x400, 0, VSSegmentUnknown, true},
          {S + 0x2400, S + 0x2800, text, 0, 0, VSSegmentText, false},
          {S + 0x2800, S + 0x4000, data, 0x800, 0, VSSegmentData, false}},
         {S, S + 0x2000}},
        {"a text piece filling the area's last page: that page is never credited to the area",
         {{"__DATA", S, 0x800}, {"__TEXT", S + 0x1800, 0x1000}, {"__DATA", S + 0x2800, 0x1800}},
         {{S, kDirty}, {S + 0x1000, kDirty}, {S + 0x2000, kDirty}},
         {{S, S + 0x800, data, 0x800, 0, VSSegmentData, false},
          {S + 0x800, S + 0x1800, kUnused, 0x800, 0, VSSegmentUnknown, true},
          {S + 0x1800, S + 0x2800, text, 0, 0, VSSegmentText, false},
          {S + 0x2800, S + 0x4000, data, 0x800, 0, VSSegmentData, false}},
         {S, S + 0x2000}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSFakePlatform local;
        local.errorStream(nullptr);
        auto installed = local.install();
        auto p = local.process(42, "w");
        p.region(0x100000000, 0x4000).tag(1).resident(1);
        p.region(S, 0x10000);
        auto image = p.image("/test/lib/a");
        for (const Segment &s : c.segments) {
            image.segment(s.name, s.start, s.length);
        }
        for (const auto &[address, word] : c.pages) {
            p.pages(address, {word});
        }
        auto process = gathered();
        ASSERT_NE(process, nullptr);
        auto facts = sharedCacheFacts(*process);
        ASSERT_GE(facts.size(), c.expected.size());
        facts.resize(c.expected.size());
        EXPECT_EQ(facts, c.expected);
        std::vector<uint64_t> queried;
        for (const VSFakeCall &call : local.calls(VSFakeQuery::PageRangeQuery)) {
            queried.push_back(call.address);
        }
        EXPECT_EQ(queried, c.queriedAddresses);
    }
}

TEST_F(UserProcessTest, SharedCacheFoundWithoutAnyRegionBelowIt) {
    auto p = fake.process(42, "w");
    p.region(S, 0x10000);
    p.region(S + 0x200000000, 0x1000).tag(1);
    auto process = gathered();
    ASSERT_NE(process, nullptr);
    const std::vector<RegionFacts> expected = {
        {S, S + 0x10000, kUnused, 0, 0, VSSegmentUnknown, true},
        {S + 0x200000000, S + 0x200001000, "malloc metadata", 0, 0, VSSegmentNone, false},
    };
    EXPECT_EQ(factsOf(*process), expected);
    // The range came from a top-level query of its own address.
    bool askedAtStart = false;
    for (const VSFakeCall &call : fake.calls(VSFakeQuery::RegionInfo)) {
        askedAtStart = askedAtStart || call.address == 0;
    }
    EXPECT_TRUE(askedAtStart);
}

// ---- stopping rules and failures ----------------------------------------------------------

TEST_F(UserProcessTest, WalkStopsAfterTheAllOnesTagRun) {
    fake.platformCodeForAll(VSPlatformNone);
    auto p = fake.process(42, "w");
    p.region(0x10000, 0x1000).tag(1);
    p.region(0x20000, 0x1000).tag(0xFFFFFFFF);
    p.region(0x30000, 0x1000).tag(0xFFFFFFFF);
    p.region(0x40000, 0x1000).tag(2);
    p.region(0x50000, 0x1000).tag(0xFFFFFFFF);
    auto process = gathered();
    ASSERT_NE(process, nullptr);
    const auto facts = factsOf(*process);
    ASSERT_EQ(facts.size(), 3u);
    EXPECT_EQ(facts[2].start, 0x30000u);
    EXPECT_EQ(facts[2].name, "Non-volatile physical vestage");
    EXPECT_TRUE(process->errors().empty());
    EXPECT_TRUE(process->warnings().empty());
}

TEST_F(UserProcessTest, FailuresDuringTheWalkBecomeWarningsOnlyForAProcessThatWentAway) {
    struct Case {
        const char *what;
        std::function<void(VSFakeProcessBuilder &)> script;
        bool alive;
        std::vector<std::string> warnings;
        std::vector<std::string> errors;
    };
    const std::vector<Case> cases = {
        {"exited", [](VSFakeProcessBuilder &p) { p.exitsAt(VSFakeQuery::RegionRecurse, 3); }, true,
         {"w [42]: message to a dead port (process exited)"}, {}},
        {"became a zombie", [](VSFakeProcessBuilder &p) { p.becomesZombieAt(VSFakeQuery::RegionRecurse, 3); }, true,
         {"w [42]: message to a dead port (zombie)"}, {}},
        {"the dead-port code from a process that is still running",
         [](VSFakeProcessBuilder &p) { p.failOnCall(VSFakeQuery::RegionRecurse, 3, vs::kReturnDeadPort); }, true, {},
         {"w [42]: message to a dead port"}},
        {"another code from a process that exited",
         [](VSFakeProcessBuilder &p) {
             p.exitsAt(VSFakeQuery::RegionRecurse, 3).failOnCall(VSFakeQuery::RegionRecurse, 3, 0x6);
         },
         true, {}, {"w [42]: error 0x6"}},
        {"exited, for a target that is not alive", [](VSFakeProcessBuilder &p) { p.exitsAt(VSFakeQuery::RegionRecurse, 3); },
         false, {}, {"w [42]: message to a dead port"}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSFakePlatform local;
        local.errorStream(nullptr).platformCodeForAll(VSPlatformNone);
        auto installed = local.install();
        auto p = local.process(42, "w");
        p.region(0x10000, 0x1000).tag(1);
        p.region(0x20000, 0x1000).tag(2);
        p.region(0x30000, 0x1000).tag(3);
        c.script(p);

        std::unique_ptr<VSUserProcess> process;
        if (c.alive) {
            process = userProcess(42);
        } else {
            process = NotAliveProcess::make(42);
        }
        ASSERT_NE(process, nullptr);
        ::testing::internal::CaptureStderr();
        process->gatherData();
        EXPECT_EQ(::testing::internal::GetCapturedStderr(),
                  "bailing out for process w [42]; data may be incomplete!\n");
        EXPECT_EQ(process->warnings(), c.warnings);
        EXPECT_EQ(process->errors(), c.errors);
        EXPECT_EQ(process->memoryRegions().size(), 2u);  // what was found before the failure
        ASSERT_EQ(local.reportedErrors().size(), 1u);
        EXPECT_EQ(local.reportedErrors()[0].first, "region_recurse");
    }
}

TEST_F(UserProcessTest, FailedPageQueryInTheSharedCacheEndsTheWalk) {
    auto p = sharedCacheProcess();
    p.image("/test/lib/a").segment("__DATA", S, 0x1000).segment("__DATA", S + 0x2000, 0x1000);
    p.region(S + 0x200000000, 0x1000).tag(1);
    p.exitsAt(VSFakeQuery::PageRangeQuery, 2);
    auto process = userProcess(42);
    ASSERT_NE(process, nullptr);
    ::testing::internal::CaptureStderr();
    process->gatherData();
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "bailing out for process w [42]; data may be incomplete!\n");
    EXPECT_EQ(process->warnings(), std::vector<std::string>{"w [42]: invalid argument (process exited)"});
    EXPECT_TRUE(process->errors().empty());
    ASSERT_EQ(fake.reportedErrors().size(), 1u);
    EXPECT_EQ(fake.reportedErrors()[0].first, "page_range_query");
    // The region below, the first piece and the gap before the failing one.
    const auto facts = factsOf(*process);
    ASSERT_EQ(facts.size(), 3u);
    EXPECT_EQ(facts[2].name, kUnused);
}

TEST_F(UserProcessTest, RegionInfoFailureTakesTheErrorPath) {
    auto p = sharedCacheProcess();
    p.failFromCall(VSFakeQuery::RegionInfo, 1, 0x7);
    auto process = userProcess(42);
    ASSERT_NE(process, nullptr);
    // The bisection gives up at once; the walk's first top-level query fails.
    ::testing::internal::CaptureStderr();
    process->gatherData();
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "bailing out for process w [42]; data may be incomplete!\n");
    EXPECT_EQ(process->errors(), std::vector<std::string>{"w [42]: error 0x7"});
    ASSERT_EQ(fake.reportedErrors().size(), 1u);
    EXPECT_EQ(fake.reportedErrors()[0].first, "region_info");
}

}  // namespace
