// Capturing heapfiles on the scripted platform: what a snapshot records,
// how its object ids keep or lose sharing, the processes a capture
// refuses, and the atomic write.

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "model/memory_region.h"
#include "targets/heapfile_capture.h"
#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::ScratchFile;

constexpr const char *kApp = "/opt/vestage-capture-test/svc";
constexpr const char *kLibrary = "/opt/vestage-capture-test/libdata.so";

class HeapfileCaptureTest : public vs::testing::TargetTest {
protected:
    HeapfileCaptureTest() { fake.pageSize(4096); }

    // A process with an executable image, anonymous memory with reusable
    // pages, a mapped file, named anonymous memory and a region without
    // an object.
    VSFakeProcessBuilder scriptProcess(int32_t pid) {
        auto p = fake.process(pid, "svc").executable(kApp).platformCode(VSPlatformNone);
        p.region(0x10000, 0x2000).file(kApp).resident(2).objectId(5).protection(5, 7).shareMode(1);
        p.region(0x12000, 0x1000).file(kApp).resident(1).dirtied(1).objectId(5).offset(0x2000).shareMode(1);
        p.region(0x20000, 0x4000).tag(vs::kTagSbrk).resident(4).dirtied(1).reusable(1).swappedOut(0).objectId(7);
        p.region(0x30000, 0x2000).file(kLibrary).resident(2).objectId(8).referenceCount(3).shareMode(1);
        p.region(0x40000, 0x1000).tag(poolTag).resident(1).objectId(9);
        p.region(0x50000, 0x1000).objectId(0);
        p.image(kApp).segment("__TEXT", 0x10000, 0x2000).segment("__DATA", 0x12000, 0x1000);
        return p;
    }

    const uint32_t poolTag = vs::registerDynamicTagName("capture test pool");
};

TEST_F(HeapfileCaptureTest, SnapshotRecordsWhatTheLiveWalkSees) {
    scriptProcess(300).resourceUsage(7 << 20, 9 << 20);
    vs::HeapfileError error;
    const auto snapshot = vs::HeapfileCapture({}, 1).capture(300, &error);
    ASSERT_TRUE(snapshot.has_value()) << error.description;

    EXPECT_EQ(snapshot->pid, 300);
    EXPECT_EQ(snapshot->name, "svc");
    EXPECT_TRUE(snapshot->is64bit);
    EXPECT_EQ(snapshot->pageSize, 4096u);
    EXPECT_EQ(snapshot->physVestage, 7u << 20);
    EXPECT_EQ(snapshot->physVestagePeak, 9u << 20);
    EXPECT_FALSE(snapshot->breakDownPhysVestage);
    EXPECT_EQ(vs::platformCodeForHeapfileDescription(snapshot->description), VSPlatformNone);

    struct Expected {
        uint64_t address;
        std::string type;
        std::optional<std::string> path;
        uint64_t resident, dirty;
        std::optional<std::string> tagName;
    };
    const std::vector<Expected> expected = {
        {0x10000, "__TEXT", kApp, 0x2000, 0, std::nullopt},
        {0x12000, "__DATA", kApp, 0x1000, 0x1000, std::nullopt},
        // Anonymous: every resident page but the reusable one is dirty, as
        // the live walk counts it.
        {0x20000, "sbrk", std::nullopt, 0x4000, 0x3000, std::nullopt},
        {0x30000, "mapped file", kLibrary, 0x2000, 0, std::nullopt},
        {0x40000, "capture test pool", std::nullopt, 0x1000, 0x1000, "capture test pool"},
        {0x50000, "VM_ALLOCATE", std::nullopt, 0, 0, std::nullopt},
    };
    ASSERT_EQ(snapshot->regions.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(expected[i].type);
        const VSHeapfileRegion &r = snapshot->regions[i];
        EXPECT_EQ(r.address, expected[i].address);
        EXPECT_EQ(r.type, expected[i].type);
        EXPECT_EQ(r.path, expected[i].path);
        EXPECT_EQ(r.residentBytes, expected[i].resident);
        EXPECT_EQ(r.dirtyBytes, expected[i].dirty);
        EXPECT_EQ(r.userTagName, expected[i].tagName);
        EXPECT_EQ(r.purgeableState, VSPurgeableDeny);
    }
    EXPECT_EQ(snapshot->regions[0].protection, 5);
    EXPECT_EQ(snapshot->regions[3].referenceCount, 3);
    EXPECT_EQ(snapshot->regions[3].externalPager, 1);
    EXPECT_EQ(snapshot->regions[5].objectId, 0u);  // no object stays no object
    // One object at two offsets: two objects, since the heapfile walk puts
    // every region of an object at offset 0.
    EXPECT_NE(snapshot->regions[0].objectId, snapshot->regions[1].objectId);
    // The capture leaves nothing open.
    EXPECT_EQ(fake.openTaskHandles(), 0u);
}

TEST_F(HeapfileCaptureTest, ObjectIdsShareWithinASessionAndThroughStableIdentities) {
    scriptProcess(300);
    scriptProcess(301);
    const vs::HeapfileCapture session({}, 1);
    const vs::HeapfileCapture otherSession({}, 2);
    const auto a = session.capture(300, nullptr);
    const auto b = session.capture(301, nullptr);
    const auto c = otherSession.capture(301, nullptr);
    ASSERT_TRUE(a && b && c);
    for (size_t i = 0; i + 1 < a->regions.size(); ++i) {
        SCOPED_TRACE(a->regions[i].type);
        EXPECT_EQ(a->regions[i].objectId, b->regions[i].objectId);  // as live: same object, same id
        EXPECT_NE(b->regions[i].objectId, c->regions[i].objectId);  // another session never meets it
    }

    // With stable identities, files share across sessions; memory without
    // an identity still does not.
    const vs::RegionIdentityProvider identities = [](VSTaskHandle) {
        return std::map<uint64_t, std::string>{{0x30000, "file 8:1 inode 99 offset 0"}};
    };
    const auto d = vs::HeapfileCapture(identities, 1).capture(300, nullptr);
    const auto e = vs::HeapfileCapture(identities, 2).capture(301, nullptr);
    ASSERT_TRUE(d && e);
    EXPECT_EQ(d->regions[3].objectId, e->regions[3].objectId);
    EXPECT_NE(d->regions[2].objectId, e->regions[2].objectId);
}

TEST_F(HeapfileCaptureTest, ProcessesThatCannotBeCapturedSayWhy) {
    fake.kernelProcess();
    fake.process(310, "locked").refuseTaskHandle(5);
    fake.errorText(5, "permission refused");
    auto cached = fake.process(311, "cached");  // 64-bit: the double places a shared cache
    cached.region(0x10000, 0x1000).resident(1);
    auto leaving = fake.process(312, "leaving").platformCode(VSPlatformNone);
    leaving.region(0x10000, 0x1000).resident(1);
    leaving.region(0x20000, 0x1000).resident(1);
    leaving.exitsAt(VSFakeQuery::RegionRecurse, 2);

    const std::vector<std::pair<int32_t, std::string>> cases = {
        {999, "process 999: no such process, or not permitted to see it"},
        {0, "process 0: the kernel cannot be captured"},
        {310, "process 310: permission refused"},
        {311, "process 311: has a shared cache region, which a heapfile capture cannot record"},
        {312, "process 312: leaving [312]: message to a dead port (process exited)"},
    };
    for (const auto &[pid, description] : cases) {
        SCOPED_TRACE(pid);
        vs::HeapfileError error;
        ::testing::internal::CaptureStderr();
        EXPECT_FALSE(vs::HeapfileCapture({}, 1).capture(pid, &error).has_value());
        ::testing::internal::GetCapturedStderr();
        EXPECT_EQ(error.description, description);
    }
    // A capture reports to its caller, not to the run's global errors.
    EXPECT_TRUE(VSProcess::globalErrors().empty());
    EXPECT_EQ(fake.openTaskHandles(), 0u);
}

TEST(HeapfileFileNameTest, NamesAreSafeFileNames) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"svc", "svc-42.heap"},
        {"", "process-42.heap"},
        {"a/b", "a_b-42.heap"},
        {".hidden", "_hidden-42.heap"},
        {"tab\there", "tab_here-42.heap"},
        {"with space", "with space-42.heap"},
    };
    for (const auto &[name, expected] : cases) {
        VSHeapfileSnapshot snapshot;
        snapshot.pid = 42;
        snapshot.name = name;
        EXPECT_EQ(vs::heapfileFileName(snapshot), expected) << name;
    }
}

TEST(HeapfileWriteTest, WritesReplaceWholeFilesAndFailuresNameTheFile) {
    ScratchFile scratch("old contents");
    const std::string &path = scratch.path();
    vs::HeapfileError error;
    ASSERT_TRUE(vs::writeFileAtomically(path, "new contents\n", &error)) << error.description;
    EXPECT_EQ(vs::readWholeFile(path, nullptr), "new contents\n");
    // Only the file itself is left: no temporary beside it.
    size_t entries = 0;
    for (const auto &entry : std::filesystem::directory_iterator(scratch.directory())) {
        (void)entry;
        ++entries;
    }
    EXPECT_EQ(entries, 1u);

    const std::string missing = scratch.directory() + "/no/such/dir/x.heap";
    EXPECT_FALSE(vs::writeFileAtomically(missing, "x", &error));
    EXPECT_NE(error.description.find(missing), std::string::npos) << error.description;
    EXPECT_NE(error.description.find(std::strerror(ENOENT)), std::string::npos) << error.description;

    // The destination is a non-empty directory: the rename fails and the
    // temporary goes away.
    const std::string occupied = scratch.directory() + "/occupied";
    std::filesystem::create_directories(occupied + "/inside");
    EXPECT_FALSE(vs::writeFileAtomically(occupied, "x", &error));
    EXPECT_NE(error.description.find("cannot rename"), std::string::npos) << error.description;
    entries = 0;
    for (const auto &entry : std::filesystem::directory_iterator(scratch.directory())) {
        (void)entry;
        ++entries;
    }
    EXPECT_EQ(entries, 2u);
}

}  // namespace
