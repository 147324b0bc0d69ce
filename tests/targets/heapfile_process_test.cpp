// Heapfile targets: what they answer, how the walk rebuilds images and region records, files that cannot be loaded;
// and capturing them: object ids, refused processes, file names.

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>

#include "targets/heapfile_capture.h"
#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::region;
using vs::testing::ScratchFile;
using vs::testing::snapshotOf;

// A heapfile target of the snapshot, gathered, with its protected parts in reach.
class OpenHeapfileProcess : public VSHeapfileProcess {
public:
    static std::unique_ptr<OpenHeapfileProcess> open(const VSHeapfileSnapshot &snapshot) {
        ScratchFile file(vs::heapfileText(snapshot));
        auto process = std::make_unique<OpenHeapfileProcess>();
        EXPECT_TRUE(process->initWithHeapfile(file.path(), nullptr));
        process->gatherData();
        return process;
    }
    using VSHeapfileProcess::_regionInfoForHeapfileRegion;
};

// "name (detailed name) [cache] dirty/swapped/reclaimable/clean" per region.
std::vector<std::string> describe(const VSMemoryRegionList &regions) {
    std::vector<std::string> out;
    for (const auto &r : regions) {
        out.push_back(r->name().value_or("") + " (" + r->detailedName().value_or("-") + ")" +
                      (r->inSharedCache() ? " cache " : " ") + std::to_string(r->dirtySize()) + "/" +
                      std::to_string(r->swappedSize()) + "/" + std::to_string(r->reclaimableSize()) + "/" +
                      std::to_string(r->cleanNonSpecSize()));
    }
    return out;
}

class HeapfileProcessTest : public vs::testing::TargetTest {};

TEST_F(HeapfileProcessTest, TheTargetAnswersFromTheFileNotFromTheLiveSystem) {
    // A live process with the same pid and live state of its own: none of it may leak in.
    fake.process(4242, "live-twin").dirtyFlags(0x3).resourceUsage(1, 1).kernelMemory(100, 0, 0, 0);
    VSHeapfileSnapshot snapshot = snapshotOf({region({0x1000, 0x1000, "anon"})}, "iPhone ARM64", 16384);
    snapshot.is64bit = false;
    snapshot.physVestage = 5 << 20;
    auto process = OpenHeapfileProcess::open(snapshot);
    EXPECT_EQ(process->displayString(), "worker [4242] (heapfile)");
    EXPECT_EQ(std::tuple(process->pageSize(), process->is64bit(), process->_isAlive(), process->phys_vestage()),
              std::tuple(16384u, false, false, 5u << 20));
    EXPECT_EQ(process->idleExitStatus(), VSIdleExitUnknown);
    EXPECT_EQ(process->sharedRegionBase(), 0x180000000u);  // the description, not the pointer width, places it
    EXPECT_EQ(process->auxData()->entries().count("Kernel memory"), 0u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::TaskHandleForPid) + fake.callCount(VSFakeQuery::PidResourceUsage), 0u);
}

TEST_F(HeapfileProcessTest, RecordCountersArePagesOutsideTheSharedCacheAndBytesInside) {
    using Case = std::tuple<std::string, uint32_t, uint64_t, uint32_t>;
    for (const auto &[description, pageSize, address, expected] : std::vector<Case>{
             {"ARM64", 16384, 0x100000000, 2},  // 40960 bytes over the page size, rounded down
             {"ARM64", 16384, 0x180000000, 40960}, {"ARM64", 16384, 0x280000000, 2}, {"ARMv7", 4096, 0x1A000000, 40960},
             {"X86-64, no shared region", 4096, 0x7FFF00001000, 10}}) {
        VSHeapfileRegion recorded =
            region({address, 0x100000, "anon", {}, false, 0, 40960, 40960, 40960, 0x1234500000042});
        recorded.sharedNowPrivateBytes = 40960;
        recorded.submap = 3;
        const VSRegionInfo info = OpenHeapfileProcess::open(snapshotOf({recorded}, description, pageSize))
                                      ->_regionInfoForHeapfileRegion(recorded);
        EXPECT_EQ(std::tuple(info.residentPages, info.dirtiedPages, info.swappedOutPages, info.sharedNowPrivatePages),
                  std::tuple(expected, expected, expected, expected)) << address;
        EXPECT_EQ(info.objectId, 0x42u);  // the low 32 bits
        EXPECT_EQ(info.isSubmap, 1);      // the lowest bit
    }
}

TEST_F(HeapfileProcessTest, TheWalkRebuildsImagesNamesRegionsAndKeepsTheRecordedBytes) {
    const uint64_t base = 0x180000000;
    const auto purgeable = [](uint64_t address, int32_t state) {  // two pages resident, one of them dirty
        return region({address, 0x10000, "anon", {}, false, 0, 0x8000, 0x4000, 0, 7, state});
    };
    VSHeapfileSnapshot snapshot = snapshotOf(
        {
            region({0x10000, 0x2000, "__TEXT", "/bin/app", true}),
            region({0x12000, 0x1000, "MALLOC_SMALL", {}, false, 30}),
            region({0x13000, 0x1000, "__DATA_DIRTY", "/bin/app"}),
            region({0x14000, 0x3000, "mapped file", "/data/table", true}),
            region({0x17000, 0x1000, "shared memory", "/memfd:pool", false}),  // no file behind: named by tag
            region({0x18000, 0x1000, "__LINKEDIT", "/bin/app", true}),
            region({0x19000, 0x1000, "__OBJECTS", "/bin/app", true}),  // no segment kind the walk knows
            region({0x100000000, 0x10000, "anon", {}, false, 0, 0x10000, 0x4000}),  // recorded dirty as it is
            purgeable(0x100010000, VSPurgeableNonVolatile),
            purgeable(0x100020000, VSPurgeableVolatile),
            purgeable(0x100030000, VSPurgeableEmpty),
            region({base + 0x8000, 0xC000, "__DATA", "/lib/a.so", true, 0, 0xC000, 0xA000, 0x2000}),
            region({base + 0x14000, 0x2000, "unused", {}, false, 0, 0, 4096}),  // a gap ending inside a page
            region({base + 0x18000, 0x4000, "unused", {}, false, 0, 0, 4096}),  // page-aligned: never classified
            region({base + 0x1C000, 0x4000, "__LINKEDIT", "/lib/a.so", true, 0, 0x4000, 0x4000}),
        },
        "iPhone ARM64", 16384);
    snapshot.breakDownPhysVestage = true;  // as recorded, whatever this system says
    auto process = OpenHeapfileProcess::open(snapshot);
    const std::string untagged = "untagged (\"VM_ALLOCATE\")", unused = "unused rtloader shared cache area (-) cache";
    EXPECT_EQ(describe(process->memoryRegions()),
              (std::vector<std::string>{
                  "__TEXT /bin/app (/bin/app) 0/0/0/0", "stack (-) 0/0/0/0", "__DATA_DIRTY /bin/app (/bin/app) 0/0/0/0",
                  "mapped file (/data/table) 0/0/0/0", untagged + " (-) 0/0/0/0",
                  "__LINKEDIT /bin/app (/bin/app) 0/0/0/0", "mapped file (/bin/app) 0/0/0/0",
                  untagged + " (-) 16384/0/0/49152",
                  untagged + " (purgeable non-volatile) (-) 16384/0/0/16384", untagged + " (-) 0/0/32768/0",
                  untagged + " (-) 0/0/65536/0",  // empty: the whole region
                  "__DATA /lib/a.so (-) cache 40960/8192/0/0", unused + " 4096/0/0/0", unused + " 0/0/0/0",
                  "__LINKEDIT rtloader shared cache (-) cache 0/0/0/0"}));
    EXPECT_EQ(fake.callCount(VSFakeQuery::PageRangeQuery), 0u);
    const VSMemoryRegionList &regions = process->memoryRegions();  // segment kinds come from the rebuilt images
    EXPECT_EQ(std::tuple(regions[0]->segment(), regions[2]->segment(), regions[5]->segment(), regions[6]->segment()),
              std::tuple(VSSegmentText, VSSegmentData, VSSegmentLinkedit, VSSegmentNone));
}

// Only regular files of a bounded size are read: a device would be read until memory runs out, a FIFO would
// block the run in open(). Numbers the JSON library refuses are the file's error, not an abort.
TEST_F(HeapfileProcessTest, FilesThatCannotBeLoadedSayWhy) {
    ScratchFile bad("{\"format\": \"vestage-heapfile\", \"version\": 1");
    ScratchFile overflowing("[-1e400]");
    ScratchFile unknownPlatform(vs::heapfileText(snapshotOf({}, "arm64 in lower case")));
    const std::string fifo = bad.directory() + "/fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    const std::string huge = bad.directory() + "/huge.heap";
    std::ofstream{huge}.close();
    ASSERT_EQ(::truncate(huge.c_str(), int64_t(vs::kMaxHeapfileSize) + 1), 0);  // sparse: no disk needed
    using vs::kPosixErrorDomain, vs::kHeapfileErrorDomain, vs::kVestageErrorDomain;
    const std::vector<std::tuple<std::string, std::string_view, int64_t, std::string, std::string>> cases = {
        {bad.directory() + "/missing", kPosixErrorDomain, ENOENT, std::strerror(ENOENT), ""},
        {bad.directory(), kPosixErrorDomain, EISDIR, "a directory, not a regular file", ""},
        {"/dev/zero", kPosixErrorDomain, EINVAL, "a character device, not a regular file", ""},
        {fifo, kPosixErrorDomain, EINVAL, "a FIFO, not a regular file", ""},
        {huge, kPosixErrorDomain, EFBIG, "larger than 1024 MiB, the most vestage reads", ""},
        {bad.path(), kHeapfileErrorDomain, vs::kHeapfileErrorSyntax,
         "the JSON document is truncated (it ends after 43 bytes)", ""},
        {overflowing.path(), kHeapfileErrorDomain, vs::kHeapfileErrorSyntax,
         "not a usable JSON document ([json.exception.out_of_range.406] number overflow parsing '-1e400')", ""},
        {unknownPlatform.path(), kVestageErrorDomain, 2,
         "Unable to determine platform from memory graph process description",
         "Unable to determine platform architecture of target\n"},
    };
    for (const auto &[path, domain, code, description, standardError] : cases) {
        SCOPED_TRACE(description);
        vs::HeapfileError error;
        ::testing::internal::CaptureStderr();
        EXPECT_EQ(VSHeapfileProcess::processWithHeapfile(path, &error), nullptr);
        EXPECT_EQ(::testing::internal::GetCapturedStderr(), standardError);
        EXPECT_EQ(std::tuple(error.domain, error.code, error.description),
                  std::tuple(std::string(domain), code, description));
    }
}

// ---- capture ----

TEST_F(HeapfileProcessTest, CapturedObjectIdsShareWithinASessionOnly) {
    for (int32_t pid : {300, 301}) {
        auto p = fake.process(pid, "svc").platformCode(VSPlatformNone);
        p.region(0x10000, 0x2000).file("/opt/svc").resident(2).objectId(5);
        p.region(0x12000, 0x1000).file("/opt/svc").resident(1).objectId(5).offset(0x2000);
        p.region(0x20000, 0x4000).tag(1).resident(4).objectId(7);
        p.region(0x50000, 0x1000).objectId(0);
    }
    const vs::HeapfileCapture session({}, 1), otherSession({}, 2);
    const auto a = session.capture(300, nullptr), b = session.capture(301, nullptr);
    const auto c = otherSession.capture(301, nullptr);
    ASSERT_TRUE(a && b && c);
    // One object at two offsets stays one object, each region at its offset in it.
    EXPECT_EQ(a->regions[0].objectId, a->regions[1].objectId);
    EXPECT_EQ(std::make_pair(a->regions[0].offset, a->regions[1].offset), std::make_pair(uint64_t{0}, uint64_t{0x2000}));
    for (size_t i = 0; i < 3; ++i) {
        EXPECT_EQ(a->regions[i].objectId, b->regions[i].objectId) << i;  // the same object, the same id
        EXPECT_NE(b->regions[i].objectId, c->regions[i].objectId) << i;  // another session never meets it
    }
    EXPECT_EQ(a->regions[3].objectId, 0u);  // no object stays no object
}

TEST_F(HeapfileProcessTest, ProcessesThatCannotBeCapturedSayWhy) {
    fake.kernelProcess();
    fake.errorText(5, "permission refused");
    fake.process(310, "locked").refuseTaskHandle(5);
    fake.process(311, "cached").region(0x10000, 0x1000).resident(1);  // 64-bit: the double places a shared cache
    auto leaving = fake.process(312, "leaving").platformCode(VSPlatformNone).exitsAt(VSFakeQuery::RegionRecurse, 2);
    leaving.region(0x10000, 0x1000).resident(1);
    leaving.region(0x20000, 0x1000).resident(1);
    const std::vector<std::pair<int32_t, std::string>> cases = {
        {999, "process 999: no such process, or not permitted to see it"},
        {0, "process 0: the kernel cannot be captured"},
        {310, "process 310: permission refused"},
        {311, "process 311: has a shared cache region, which a heapfile capture cannot record"},
        {312, "process 312: leaving [312]: message to a dead port (process exited)"},
    };
    for (const auto &[pid, description] : cases) {
        vs::HeapfileError error;
        ::testing::internal::CaptureStderr();
        EXPECT_FALSE(vs::HeapfileCapture({}, 1).capture(pid, &error).has_value());
        ::testing::internal::GetCapturedStderr();
        EXPECT_EQ(error.description, description);
    }
    EXPECT_TRUE(VSProcess::globalErrors().empty());  // a capture reports to its caller only
    EXPECT_EQ(fake.openTaskHandles(), 0u);
}

TEST(HeapfileFileNameTest, NamesAreSafeFileNames) {
    for (const auto &[name, expected] : std::vector<std::pair<std::string, std::string>>{
             {"svc", "svc-42.heap"}, {"", "process-42.heap"}, {"a/b", "a_b-42.heap"}, {".hidden", "_hidden-42.heap"},
             {"tab\there", "tab_here-42.heap"}, {"with space", "with space-42.heap"}}) {
        VSHeapfileSnapshot snapshot;
        snapshot.pid = 42;
        snapshot.name = name;
        EXPECT_EQ(vs::heapfileFileName(snapshot), expected) << name;
    }
}

}  // namespace
