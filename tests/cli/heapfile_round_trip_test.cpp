// A live child with arranged memory, held still, gathered twice: once live
// and once through a heapfile captured from it. The analysis must see the
// same categories with the same figures either way.
//
// One split is allowed to differ: live, every mapping of a file is one
// object, so a library's copied-on-write relro and data pages merge into
// one object named after whichever comes first ("__DATA_CONST"). A
// heapfile places every region of an object at offset 0, so the capture
// writes each (object, offset) as an object of its own, and the data pages
// keep their "__DATA" name. Per image the data segments add up the same.

#include <gtest/gtest.h>
#include <unistd.h>

#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "analysis/vestage.h"
#include "cli/heapfile_capture_identities.h"
#include "targets/heapfile_capture.h"
#include "targets/heapfile_process.h"
#include "targets/platform/linux/linux_platform.h"
#include "tests/support/run_program.h"
#include "tests/targets/heapfile_test_support.h"

namespace {

using Figures = std::tuple<uint64_t, uint64_t, uint64_t, uint64_t, uint64_t, int32_t>;

// Category name -> dirty, swapped, clean, reclaimable, wired, regions.
std::map<std::string, Figures> categoriesOf(std::unique_ptr<VSProcess> target) {
    std::vector<std::unique_ptr<VSProcess>> targets;
    targets.push_back(std::move(target));
    VSVestage vestage(std::move(targets));
    vestage.gatherData();
    std::map<std::string, Figures> figures;
    for (const auto &[name, category] : vestage._categoriesForAllProcesses()) {
        figures[name] = {category.totalDirtySize(),  category.totalSwappedSize(),     category.totalCleanSize(),
                         category.totalReclaimableSize(), category.totalWiredSize(), category.totalRegions()};
    }
    return figures;
}

// Folds the data segments of one image into one row.
std::map<std::string, Figures> dataSegmentsFolded(const std::map<std::string, Figures> &figures) {
    std::map<std::string, Figures> folded;
    for (const auto &[name, f] : figures) {
        std::string key = name;
        if (name.rfind("__DATA", 0) == 0 && name.find(' ') != std::string::npos) {
            key = "data segments of" + name.substr(name.find(' '));
        }
        Figures &sum = folded[key];
        std::get<0>(sum) += std::get<0>(f);
        std::get<1>(sum) += std::get<1>(f);
        std::get<2>(sum) += std::get<2>(f);
        std::get<3>(sum) += std::get<3>(f);
        std::get<4>(sum) += std::get<4>(f);
        std::get<5>(sum) += std::get<5>(f);
    }
    return folded;
}

std::string describe(const std::map<std::string, Figures> &figures) {
    std::ostringstream text;
    for (const auto &[name, f] : figures) {
        text << name << ": dirty " << std::get<0>(f) << " swapped " << std::get<1>(f) << " clean " << std::get<2>(f)
             << " reclaimable " << std::get<3>(f) << " wired " << std::get<4>(f) << " regions " << std::get<5>(f)
             << "\n";
    }
    return text.str();
}

class LinuxPlatformInstalled {
public:
    LinuxPlatformInstalled() : _previous(VSPlatform::installed()) { VSPlatform::setCurrent(&platform); }
    ~LinuxPlatformInstalled() { VSPlatform::setCurrent(_previous); }
    VSLinuxPlatform platform;

private:
    VSPlatform *_previous;
};

TEST(HeapfileRoundTrip, CategoryTotalsOfAHeapfileMatchTheLiveProcess) {
    vs::test::MemChild child({"anon:private:16:10", "file:data:" VESTAGE_SOURCE_DIR "/CMakeLists.txt",
                              "shared:common:4", "exec:jit:2", "none:fence:2", "thread:worker", "libc:libc"});
    ASSERT_TRUE(child.ready());
    LinuxPlatformInstalled linux;

    std::unique_ptr<VSProcess> live = VSProcess::processWithPid(child.pid());
    if (live == nullptr) {
        GTEST_SKIP() << "the child's memory cannot be read here";
    }
    const std::map<std::string, Figures> liveFigures = categoriesOf(std::move(live));

    vs::HeapfileError error;
    const vs::HeapfileCapture capture(
        [&](VSTaskHandle task) { return vs::linuxRegionIdentities(linux.platform, task); });
    const std::optional<VSHeapfileSnapshot> snapshot = capture.capture(child.pid(), &error);
    ASSERT_TRUE(snapshot.has_value()) << error.description;
    vs::testing::ScratchFile directory("");
    const std::string path = directory.directory() + "/" + vs::heapfileFileName(*snapshot);
    ASSERT_TRUE(vs::writeFileAtomically(path, vs::heapfileText(*snapshot), &error)) << error.description;

    std::unique_ptr<VSHeapfileProcess> heapfile = VSHeapfileProcess::processWithHeapfile(path, &error);
    ASSERT_NE(heapfile, nullptr) << error.description;
    EXPECT_EQ(heapfile->pid(), child.pid());
    EXPECT_EQ(heapfile->sharedRegionSize(), 0u);
    const std::map<std::string, Figures> heapfileFigures = categoriesOf(std::move(heapfile));

    EXPECT_EQ(describe(dataSegmentsFolded(heapfileFigures)), describe(dataSegmentsFolded(liveFigures)));

    // The arrangement is visible at all: private dirty memory, a shared
    // mapping, JIT code and the libc image.
    EXPECT_GT(liveFigures.size(), 5u) << describe(liveFigures);
}

}  // namespace
