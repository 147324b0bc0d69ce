// Heapfile targets on the scripted platform: what the target answers, how
// its walk rebuilds images and names regions, the counters of its records
// inside and outside the shared cache region, and files that cannot be
// loaded.

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::OpenHeapfileProcess;
using vs::testing::region;
using vs::testing::ScratchFile;
using vs::testing::snapshotOf;

class HeapfileProcessTest : public vs::testing::TargetTest {
protected:
    // Loads the snapshot through a file and gathers it.
    std::unique_ptr<OpenHeapfileProcess> gathered(const VSHeapfileSnapshot &snapshot) {
        ScratchFile file(vs::heapfileText(snapshot));
        vs::HeapfileError error;
        auto process = OpenHeapfileProcess::open(file.path(), &error);
        EXPECT_NE(process, nullptr) << error.description;
        if (process) {
            process->gatherData();
        }
        return process;
    }
};

struct Named {
    uint64_t start;
    std::string name;
    std::optional<std::string> detailedName;
    VSSegmentKind segment;
};

TEST_F(HeapfileProcessTest, TheTargetAnswersFromTheFileNotFromTheLiveSystem) {
    // A live process with the same pid that is idle-exit clean and has its
    // own physical vestage and kernel memory: none of it may leak in.
    fake.process(4242, "live-twin").dirtyFlags(0x3).resourceUsage(1, 1).kernelMemory(100, 0, 0, 0);
    VSHeapfileSnapshot snapshot = snapshotOf({region({0x1000, 0x1000, "anon"})}, "iPhone ARM64", 16384);
    snapshot.is64bit = false;
    snapshot.physVestage = 5 << 20;
    snapshot.physVestagePeak = 9 << 20;
    snapshot.breakDownPhysVestage = true;
    ScratchFile file(vs::heapfileText(snapshot));

    auto process = VSHeapfileProcess::processWithHeapfile(file.path());
    ASSERT_NE(process, nullptr);
    EXPECT_EQ(process->pid(), 4242);
    EXPECT_EQ(process->name(), "worker");
    EXPECT_EQ(process->displayString(), "worker [4242] (heapfile)");
    EXPECT_EQ(process->pageSize(), 16384u);
    EXPECT_FALSE(process->is64bit());
    EXPECT_EQ(process->idleExitStatus(), VSIdleExitUnknown);
    EXPECT_TRUE(process->breakDownPhysVestage());
    EXPECT_FALSE(process->_isAlive());
    EXPECT_FALSE(process->anonymousDirtyRecalculation());
    // The description, not the pointer width, places the shared cache.
    EXPECT_EQ(process->sharedRegionBase(), 0x180000000u);
    EXPECT_EQ(process->sharedRegionSize(), 0x100000000u);
    EXPECT_EQ(process->phys_vestage(), 5u << 20);
    EXPECT_EQ(process->phys_vestage_peak(), 9u << 20);
    ASSERT_NE(process->graph(), nullptr);
    EXPECT_EQ(process->graph()->processDescription(), "iPhone ARM64");

    auto aux = process->auxData();
    ASSERT_NE(aux, nullptr);
    const VSAuxDataDictionary::Entries &entries = aux->entries();
    EXPECT_EQ(entries.count("phys_vestage"), 1u);
    EXPECT_EQ(entries.count("phys_vestage_peak"), 1u);
    EXPECT_EQ(entries.count("Kernel memory"), 0u);

    // Nothing is opened, so nothing is left open.
    EXPECT_EQ(fake.callCount(VSFakeQuery::TaskHandleForPid), 0u);
    process->gatherData();
    EXPECT_EQ(fake.callCount(VSFakeQuery::RegionRecurse), 0u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::PidRegionFilename), 0u);
}

TEST_F(HeapfileProcessTest, SegmentTypesBecomeImagesThatNameTheirOwnRegions) {
    auto process = gathered(snapshotOf({
        region({0x10000, 0x2000, "__TEXT", "/bin/app", true}),
        region({0x12000, 0x1000, "MALLOC_SMALL", std::nullopt, false, 30}),
        region({0x13000, 0x1000, "__DATA_DIRTY", "/bin/app"}),
        region({0x14000, 0x3000, "mapped file", "/data/table", true}),
        region({0x17000, 0x1000, "shared memory", "/memfd:pool", false}),
        region({0x18000, 0x1000, "__LINKEDIT", "/bin/app", true}),
        region({0x19000, 0x1000, "__OBJECTS", "/bin/app", true}),
    }));
    ASSERT_NE(process, nullptr);

    const std::vector<Named> expected = {
        {0x10000, "__TEXT /bin/app", "/bin/app", VSSegmentText},
        {0x12000, "stack", std::nullopt, VSSegmentNone},
        {0x13000, "__DATA_DIRTY /bin/app", "/bin/app", VSSegmentData},
        {0x14000, "mapped file", "/data/table", VSSegmentNone},
        // A path without a file behind it is not handed on: named by tag.
        {0x17000, "untagged (\"VM_ALLOCATE\")", std::nullopt, VSSegmentNone},
        {0x18000, "__LINKEDIT /bin/app", "/bin/app", VSSegmentLinkedit},
        // Not a segment kind the walk knows: no image, a mapped file.
        {0x19000, "mapped file", "/bin/app", VSSegmentNone},
    };
    const VSMemoryRegionList &regions = process->memoryRegions();
    ASSERT_EQ(regions.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(expected[i].name);
        EXPECT_EQ(regions[i]->start(), expected[i].start);
        EXPECT_EQ(regions[i]->name(), expected[i].name);
        EXPECT_EQ(regions[i]->detailedName(), expected[i].detailedName);
        EXPECT_EQ(regions[i]->segment(), expected[i].segment);
    }

    // One image per segment region, exactly covering it, in address order;
    // the type of a non-segment region did not leak into the next image.
    const VSImageList &images = process->images();
    ASSERT_EQ(images.size(), 3u);
    EXPECT_EQ(images[0].start(), 0x10000u);
    EXPECT_EQ(images[0].size(), 0x2000u);
    EXPECT_EQ(images[0].segment(), VSSegmentText);
    EXPECT_EQ(images[1].name(), "__DATA_DIRTY");
    EXPECT_EQ(images[1].start(), 0x13000u);
    EXPECT_EQ(images[1].ownerPath(), "/bin/app");
    EXPECT_EQ(images[2].segment(), VSSegmentLinkedit);
}

TEST_F(HeapfileProcessTest, RecordCountersArePagesOutsideTheSharedCacheAndBytesInside) {
    struct Case {
        const char *what;
        std::string description;
        uint32_t pageSize;
        uint64_t address;
        uint64_t bytes;
        uint32_t expected;
    };
    const std::vector<Case> cases = {
        {"outside: bytes over the page size, rounded down", "ARM64", 16384, 0x100000000, 40960, 2},
        {"inside the 64-bit shared cache: bytes", "ARM64", 16384, 0x180004000, 40960, 40960},
        {"first byte of the shared cache", "ARM64", 16384, 0x180000000, 40960, 40960},
        {"just past the shared cache", "ARM64", 16384, 0x280000000, 40960, 2},
        {"32-bit ARM shared cache", "ARMv7", 4096, 0x1A000000, 40960, 40960},
        {"no shared region at all", "X86-64, no shared region", 4096, 0x7FFF00001000, 40960, 10},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSHeapfileRegion recorded = region({c.address, 0x100000, "anon"});
        recorded.residentBytes = c.bytes;
        recorded.dirtyBytes = c.bytes;
        recorded.swappedBytes = c.bytes;
        recorded.sharedNowPrivateBytes = c.bytes;
        recorded.objectId = 0x1234500000042ull;
        recorded.submap = 3;
        ScratchFile file(vs::heapfileText(snapshotOf({recorded}, c.description, c.pageSize)));
        auto process = OpenHeapfileProcess::open(file.path());
        ASSERT_NE(process, nullptr);
        const VSRegionInfo info = process->_regionInfoForHeapfileRegion(recorded);
        EXPECT_EQ(info.residentPages, c.expected);
        EXPECT_EQ(info.dirtiedPages, c.expected);
        EXPECT_EQ(info.swappedOutPages, c.expected);
        EXPECT_EQ(info.sharedNowPrivatePages, c.expected);
        EXPECT_EQ(info.objectId, 0x42u);  // the low 32 bits
        EXPECT_EQ(info.isSubmap, 1);      // the lowest bit
    }
}

TEST_F(HeapfileProcessTest, SharedCacheRegionsTakeTheirBytesFromTheFile) {
    const uint64_t base = 0x180000000;
    auto process = gathered(snapshotOf(
        {
            region({0x100000000, 0x10000, "anon", std::nullopt, false, 0, 0x10000, 0x4000}),
            region({base, 0x8000, "__TEXT", "/usr/lib/libA.dylib", true, 0, 0x8000, 0x8000}),
            region({base + 0x8000, 0xC000, "__DATA", "/usr/lib/libA.dylib", true, 0, 0xC000, 40960, 8192}),
            // A gap ending inside a page takes its bytes from the record too.
            region({base + 0x14000, 0x2000, "unused", std::nullopt, false, 0, 0, 4096}),
            // A page-aligned gap is never classified.
            region({base + 0x18000, 0x4000, "unused", std::nullopt, false, 0, 0, 4096}),
            region({base + 0x1C000, 0x4000, "__LINKEDIT", "/usr/lib/libA.dylib", true, 0, 0x4000, 0x4000}),
        },
        "iPhone ARM64", 16384));
    ASSERT_NE(process, nullptr);

    struct Expected {
        uint64_t start;
        std::string name;
        bool inSharedCache;
        uint64_t dirty;
        uint64_t swapped;
        uint64_t clean;
    };
    const std::vector<Expected> expected = {
        // Recorded dirty bytes as they are: no recalculation of anonymous memory.
        {0x100000000, "untagged (\"VM_ALLOCATE\")", false, 0x4000, 0, 0xC000},
        {base, "__TEXT /usr/lib/libA.dylib", true, 0, 0, 0},
        {base + 0x8000, "__DATA /usr/lib/libA.dylib", true, 40960, 8192, 0},
        {base + 0x14000, "unused rtloader shared cache area", true, 4096, 0, 0},
        {base + 0x18000, "unused rtloader shared cache area", true, 0, 0, 0},
        {base + 0x1C000, "__LINKEDIT rtloader shared cache", true, 0, 0, 0},
    };
    const VSMemoryRegionList &regions = process->memoryRegions();
    ASSERT_EQ(regions.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(expected[i].name);
        const VSMemoryRegion &r = *regions[i];
        EXPECT_EQ(r.start(), expected[i].start);
        EXPECT_EQ(r.name(), expected[i].name);
        EXPECT_EQ(r.inSharedCache(), expected[i].inSharedCache);
        EXPECT_EQ(r.dirtySize(), expected[i].dirty);
        EXPECT_EQ(r.swappedSize(), expected[i].swapped);
        EXPECT_EQ(r.cleanNonSpecSize(), expected[i].clean);
        EXPECT_EQ(r.wiredSize(), 0u);
    }
    EXPECT_EQ(fake.callCount(VSFakeQuery::PageRangeQuery), 0u);
}

TEST_F(HeapfileProcessTest, PurgeableStatesAndTheRecordedBreakdownMode) {
    struct Case {
        const char *what;
        bool breakDown;
        int32_t state;
        std::string name;
        uint64_t dirty, reclaimable, clean;
    };
    const std::string untagged = "untagged (\"VM_ALLOCATE\")";
    const std::vector<Case> cases = {
        {"non-volatile, breakdown recorded", true, VSPurgeableNonVolatile,
         untagged + " (purgeable non-volatile)", 0x2000, 0, 0x2000},
        {"non-volatile, no breakdown", false, VSPurgeableNonVolatile, untagged, 0x2000, 0, 0x2000},
        {"volatile: resident is reclaimable", false, VSPurgeableVolatile, untagged, 0, 0x4000, 0},
        {"empty: the whole region is reclaimable", false, VSPurgeableEmpty, untagged, 0, 0x8000, 0},
        {"not purgeable", true, VSPurgeableDeny, untagged, 0x2000, 0, 0x2000},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSHeapfileSnapshot snapshot =
            snapshotOf({region({0x10000, 0x8000, "anon", std::nullopt, false, 0, 0x4000, 0x2000, 0, 7, c.state})});
        snapshot.breakDownPhysVestage = c.breakDown;
        auto process = gathered(snapshot);
        ASSERT_NE(process, nullptr);
        ASSERT_EQ(process->memoryRegions().size(), 1u);
        const VSMemoryRegion &r = *process->memoryRegions()[0];
        EXPECT_EQ(r.name(), c.name);
        EXPECT_EQ(r.purgeableNonVolatile(), c.breakDown && c.state == VSPurgeableNonVolatile);
        EXPECT_EQ(r.dirtySize(), c.dirty);
        EXPECT_EQ(r.reclaimableSize(), c.reclaimable);
        EXPECT_EQ(r.cleanNonSpecSize(), c.clean);
    }
}

TEST_F(HeapfileProcessTest, TheWalkHandsOnPathsOfFilesOnlyAndStopsWhenTold) {
    ScratchFile file(vs::heapfileText(snapshotOf({
        region({0x1000, 0x1000, "mapped file", "/a", true}),
        region({0x2000, 0x1000, "shared memory", "/memfd:b", false}),
        region({0x3000, 0x1000, "mapped file", "/c", true}),
    })));
    auto process = OpenHeapfileProcess::open(file.path());
    ASSERT_NE(process, nullptr);
    std::vector<std::optional<std::string>> paths;
    process->enumerateRegions([&](uint64_t, uint64_t, VSRegionInfo &, int32_t, const std::optional<std::string> &path) {
        paths.push_back(path);
        return paths.size() == 2;
    });
    EXPECT_EQ(paths, (std::vector<std::optional<std::string>>{"/a", std::nullopt}));
}

TEST_F(HeapfileProcessTest, FilesThatCannotBeLoadedSayWhy) {
    ScratchFile bad("{\"format\": \"vestage-heapfile\", \"version\": 1");
    ScratchFile unknownPlatform(vs::heapfileText(snapshotOf({}, "arm64 in lower case")));
    ScratchFile missing("");
    std::filesystem::remove(missing.path());

    struct Case {
        const char *what;
        std::string path;
        std::string domain;
        int64_t code;
        std::string description;
        std::string standardError;
    };
    const std::vector<Case> cases = {
        {"no such file", missing.path(), std::string(vs::kPosixErrorDomain), ENOENT, std::strerror(ENOENT), ""},
        {"a directory", bad.directory(), std::string(vs::kPosixErrorDomain), EISDIR, std::strerror(EISDIR), ""},
        {"the reader's own error", bad.path(), std::string(vs::kHeapfileErrorDomain), vs::kHeapfileErrorSyntax,
         "the JSON document is truncated (it ends after 43 bytes)", ""},
        {"no known architecture", unknownPlatform.path(), std::string(vs::kVestageErrorDomain), 2,
         "Unable to determine platform from memory graph process description",
         "Unable to determine platform architecture of target\n"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        vs::HeapfileError error;
        ::testing::internal::CaptureStderr();
        EXPECT_EQ(VSHeapfileProcess::processWithHeapfile(c.path, &error), nullptr);
        EXPECT_EQ(::testing::internal::GetCapturedStderr(), c.standardError);
        EXPECT_EQ(error.domain, c.domain);
        EXPECT_EQ(error.code, c.code);
        EXPECT_EQ(error.description, c.description);
        ::testing::internal::CaptureStderr();
        EXPECT_EQ(VSHeapfileProcess::processWithHeapfile(c.path), nullptr);  // no error out
        ::testing::internal::GetCapturedStderr();
    }
}

}  // namespace
