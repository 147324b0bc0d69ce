// A live child with arranged memory, held still, gathered live and through
// a heapfile captured from it: the same categories with the same figures,
// row by row (an image's segments included).

#include <array>
#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>

#include "analysis/vestage.h"
#include "cli/heapfile_capture_identities.h"
#include "targets/heapfile_capture.h"
#include "targets/heapfile_process.h"
#include "targets/platform/linux/linux_platform.h"
#include "tests/support/run_program.h"

namespace {

// The Linux layer as the current platform for one test, the previous one back after.
struct LinuxPlatformInstalled {
    explicit LinuxPlatformInstalled(VSLinuxPlatform &platform) : previous(VSPlatform::installed()) {
        VSPlatform::setCurrent(&platform);
    }
    ~LinuxPlatformInstalled() { VSPlatform::setCurrent(previous); }
    VSPlatform *previous;
};

// Category -> dirty, swapped, clean, reclaimable, wired, regions.
std::map<std::string, std::array<uint64_t, 6>> categoriesOf(std::unique_ptr<VSProcess> target) {
    std::vector<std::unique_ptr<VSProcess>> targets;
    targets.push_back(std::move(target));
    VSVestage vestage(std::move(targets));
    vestage.gatherData();
    std::map<std::string, std::array<uint64_t, 6>> figures;
    for (const auto &[name, c] : vestage._categoriesForAllProcesses()) {
        auto &sum = figures[name];
        const uint64_t add[] = {c.totalDirtySize(),      c.totalSwappedSize(), c.totalCleanSize(),
                                c.totalReclaimableSize(), c.totalWiredSize(),   uint64_t(c.totalRegions())};
        for (size_t i = 0; i < sum.size(); ++i) sum[i] += add[i];
    }
    return figures;
}

// The child runs from a program whose name is not UTF-8 and holds a control character: it is captured all the
// same, and its name and paths arrive byte for byte.
TEST(HeapfileRoundTrip, CategoryTotalsOfAHeapfileMatchTheLiveProcess) {
    vs::test::ScratchDir programs;
    const std::string program = programs.path + "/mem\xff\x1b" "child";
    std::filesystem::copy_file(VESTAGE_TEST_BIN_DIR "/vs_memchild", program);
    std::filesystem::permissions(program, std::filesystem::perms::owner_all);
    // A private file mapping partly written holds page cache and copies.
    const std::string written = programs.path + "/written";
    std::ofstream(written) << std::string(3 * 4096, 'w');
    vs::test::MemChild child({"anon:private:16:10", "file:data:" VESTAGE_SOURCE_DIR "/CMakeLists.txt",
                              "pfile:written:" + written + ":1",
                              "shared:common:4", "exec:jit:2", "none:fence:2", "thread:worker", "libc:libc"},
                             program);
    ASSERT_TRUE(child.ready());
    VSLinuxPlatform linux;
    const LinuxPlatformInstalled installed(linux);

    std::unique_ptr<VSProcess> live = VSProcess::processWithPid(child.pid());
    ASSERT_NE(live, nullptr) << "the child's memory cannot be read here";
    const auto liveFigures = categoriesOf(std::move(live));
    vs::HeapfileError error;
    const vs::HeapfileCapture capture(vs::linuxObjectIdentity);
    const std::optional<VSHeapfileSnapshot> snapshot = capture.capture(child.pid(), &error);
    ASSERT_TRUE(snapshot.has_value()) << error.description;
    vs::test::ScratchDir directory;
    const std::string path = directory.path + "/" + vs::heapfileFileName(*snapshot);
    ASSERT_TRUE(vs::writeFileAtomically(path, vs::heapfileText(*snapshot), &error)) << error.description;
    std::unique_ptr<VSHeapfileProcess> heapfile = VSHeapfileProcess::processWithHeapfile(path, &error);
    ASSERT_NE(heapfile, nullptr) << error.description;
    EXPECT_EQ(heapfile->pid(), child.pid());
    EXPECT_EQ(heapfile->name(), "mem\xff\x1b" "child");
    EXPECT_EQ(std::filesystem::status(path).permissions(), std::filesystem::perms::owner_read |
                                                               std::filesystem::perms::owner_write);

    EXPECT_EQ(categoriesOf(std::move(heapfile)), liveFigures);
    const uint64_t writtenAt = std::stoull(child.fact("written", "start"), nullptr, 16);
    EXPECT_EQ(std::count_if(snapshot->regions.begin(), snapshot->regions.end(),
                            [&](const VSHeapfileRegion &r) { return r.address == writtenAt; }),
              2)
        << "its page cache and its copy are two parts";
    // The arrangement is visible at all: private memory, a shared mapping,
    // JIT code, the libc image.
    EXPECT_GT(liveFigures.size(), 5u);
}

// A fork family captured together and analysed from its heapfiles: the
// pages the children share with the parent count once, as they do live.
TEST(HeapfileRoundTrip, AForkFamilyCapturedTogetherSharesItsPages) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const std::string pages = std::to_string((8u << 20) / 4096);
    vs::test::MemChild parent({"anon:big:" + pages + ":" + pages, "fork:one", "fork:two"});
    ASSERT_TRUE(parent.ready());
    VSLinuxPlatform linux;
    const LinuxPlatformInstalled installed(linux);
    const std::vector<int32_t> pids = {parent.pid(), std::stoi(parent.fact("one", "pid")),
                                       std::stoi(parent.fact("two", "pid"))};
    const auto captured = vs::HeapfileCapture(vs::linuxObjectIdentity).captureTogether(pids);
    vs::test::ScratchDir directory;
    std::vector<std::unique_ptr<VSProcess>> targets;
    for (const auto &one : captured) {
        ASSERT_TRUE(one.snapshot.has_value()) << one.error.description;
        vs::HeapfileError error;
        const std::string path = directory.path + "/" + vs::heapfileFileName(*one.snapshot);
        ASSERT_TRUE(vs::writeFileAtomically(path, vs::heapfileText(*one.snapshot), &error)) << error.description;
        targets.push_back(VSHeapfileProcess::processWithHeapfile(path, &error));
        ASSERT_NE(targets.back(), nullptr) << error.description;
    }
    VSVestage vestage(std::move(targets));
    vestage.gatherData();
    uint64_t untagged = 0;
    for (const auto &[name, c] : vestage._categoriesForAllProcesses()) {
        if (name == "untagged (\"VM_ALLOCATE\")") untagged = c.totalDirtySize();
    }
    EXPECT_GE(untagged, 8u << 20);
    EXPECT_LT(untagged, 9u << 20) << "8 MiB shared by three processes is 8 MiB";
}

}  // namespace
