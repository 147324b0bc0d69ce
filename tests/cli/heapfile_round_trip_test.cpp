// A live child with arranged memory, held still, gathered live and through
// a heapfile captured from it: the same categories with the same figures.
// Only the data segments of an image may split differently (live, one file
// object is named after its first mapping; a heapfile keeps each offset's
// own name), so they are compared as one sum per image.

#include <array>
#include <filesystem>
#include <map>

#include "analysis/vestage.h"
#include "cli/heapfile_capture_identities.h"
#include "targets/heapfile_capture.h"
#include "targets/heapfile_process.h"
#include "targets/platform/linux/linux_platform.h"
#include "tests/support/run_program.h"

namespace {

// Category -> dirty, swapped, clean, reclaimable, wired, regions; the data
// segments of one image folded into one row.
std::map<std::string, std::array<uint64_t, 6>> categoriesOf(std::unique_ptr<VSProcess> target) {
    std::vector<std::unique_ptr<VSProcess>> targets;
    targets.push_back(std::move(target));
    VSVestage vestage(std::move(targets));
    vestage.gatherData();
    std::map<std::string, std::array<uint64_t, 6>> figures;
    for (const auto &[name, c] : vestage._categoriesForAllProcesses()) {
        const bool data = name.rfind("__DATA", 0) == 0 && name.find(' ') != std::string::npos;
        auto &sum = figures[data ? "data segments of" + name.substr(name.find(' ')) : name];
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
    vs::test::MemChild child({"anon:private:16:10", "file:data:" VESTAGE_SOURCE_DIR "/CMakeLists.txt",
                              "shared:common:4", "exec:jit:2", "none:fence:2", "thread:worker", "libc:libc"},
                             program);
    ASSERT_TRUE(child.ready());
    VSLinuxPlatform linux;
    const struct Restore {
        VSPlatform *previous;
        ~Restore() { VSPlatform::setCurrent(previous); }
    } restore{VSPlatform::installed()};
    VSPlatform::setCurrent(&linux);

    std::unique_ptr<VSProcess> live = VSProcess::processWithPid(child.pid());
    ASSERT_NE(live, nullptr) << "the child's memory cannot be read here";
    const auto liveFigures = categoriesOf(std::move(live));
    vs::HeapfileError error;
    const vs::HeapfileCapture capture([&](VSTaskHandle task) { return vs::linuxRegionIdentities(linux, task); });
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
    // The arrangement is visible at all: private memory, a shared mapping,
    // JIT code, the libc image.
    EXPECT_GT(liveFigures.size(), 5u);
}

}  // namespace
