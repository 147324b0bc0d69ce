// Whole runs of the program against the running kernel (pid 0): its slab
// zones and vmalloc areas must add up to what the kernel itself states in
// /proc/meminfo, it never shares memory with a process, and without the
// right to read the kernel's files it is reported with the system's reason.

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <fstream>
#include <map>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/run_program.h"

namespace {

using vs::test::runProgram;

// Bytes of a "Name:   123 kB" line of /proc/meminfo; -1 when absent.
int64_t meminfoBytes(const std::string &name) {
    std::ifstream in("/proc/meminfo");
    for (std::string line; std::getline(in, line);) {
        if (line.compare(0, name.size() + 1, name + ":") == 0) {
            return std::stoll(line.substr(name.size() + 1)) * 1024;
        }
    }
    return -1;
}

struct KernelRegion {
    uint64_t objectKind;  // bits 32-39 of the listed object id
    std::string name;
    std::string detail;
};

// The region lines of the listing that follows "kernel [0]\n\n".
std::vector<KernelRegion> kernelListing(const std::string &report) {
    std::vector<KernelRegion> regions;
    size_t at = report.find("kernel [0]\n\n");
    if (at == std::string::npos) return regions;
    std::istringstream lines(report.substr(at));
    const std::regex regionLine(R"(^ *[0-9a-f]+ - +[0-9a-f]+ \[ *([0-9a-f]+)\] +\d+ +\d+ +\d+ +\d+   (.*)$)");
    const std::vector<std::string> details = {"zone", "(user wired)", "(hidden)"};
    std::string line;
    std::getline(lines, line);  // the name line
    std::getline(lines, line);  // the empty line
    while (std::getline(lines, line) && !line.empty()) {
        std::smatch match;
        if (!std::regex_match(line, match, regionLine)) continue;  // the two header lines
        KernelRegion region;
        region.objectKind = (std::stoull(match[1], nullptr, 16) >> 32) & 0xFF;
        std::string tail = match[2];
        for (const std::string &detail : details) {
            if (tail.size() > detail.size() && tail.compare(tail.size() - detail.size() - 1, std::string::npos,
                                                            " " + detail) == 0) {
                region.detail = detail;
                break;
            }
        }
        // A region without a detail ends its line with one blank.
        region.name = tail.substr(0, tail.size() - region.detail.size() - 1);
        regions.push_back(region);
    }
    return regions;
}

struct CategoryRow {
    uint64_t dirty = 0, clean = 0, reclaimable = 0;
};

// The kernel's category table in the bytes format, by category name.
std::map<std::string, CategoryRow> kernelCategories(const std::string &report) {
    std::map<std::string, CategoryRow> rows;
    size_t at = report.find("kernel [0]: 64-bit");
    if (at == std::string::npos) return rows;
    std::istringstream lines(report.substr(at));
    const std::regex row(R"(^ *(\d+) B +(\d+) B +(\d+) B +\d+    (.*)$)");
    for (std::string line; std::getline(lines, line);) {
        std::smatch match;
        if (line.find("    TOTAL") != std::string::npos) break;
        if (std::regex_match(line, match, row)) {
            rows[match[4]] = {std::stoull(match[1]), std::stoull(match[2]), std::stoull(match[3])};
        }
    }
    return rows;
}

// True when `value` lies within `slack` (a fraction) of the range the two
// readings of the kernel's own figure span.
::testing::AssertionResult reconciles(const char *what, uint64_t value, int64_t before, int64_t after, double slack) {
    const double low = static_cast<double>(std::min(before, after)) * (1.0 - slack);
    const double high = static_cast<double>(std::max(before, after)) * (1.0 + slack);
    const auto v = static_cast<double>(value);
    if (v >= low && v <= high) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << what << ": " << value << " bytes, meminfo says " << before << " before and "
                                         << after << " after the run";
}

TEST(KernelRun, SlabZonesAndVmallocAreasReconcileWithMeminfo) {
    if (geteuid() != 0) GTEST_SKIP() << "the kernel's memory files are readable by root only";
    const int64_t slabBefore = meminfoBytes("Slab");
    const int64_t vmallocBefore = meminfoBytes("VmallocUsed");
    auto run = runProgram({"-p", "0", "-v", "-f", "bytes"});
    const int64_t slabAfter = meminfoBytes("Slab");
    const int64_t vmallocAfter = meminfoBytes("VmallocUsed");
    ASSERT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.err, "");
    ASSERT_GT(slabBefore, 0);

    const std::vector<KernelRegion> regions = kernelListing(run.out);
    ASSERT_FALSE(regions.empty()) << run.out;
    // Zones (object kind 2) and code-address sites (every kind but those of
    // zones, tags, counters and modules) by name; a name on both sides
    // would blur the sums and is left out.
    std::set<std::string> zones, vmallocSites;
    for (const KernelRegion &region : regions) {
        if (region.objectKind == 2) {
            EXPECT_EQ(region.detail, "zone") << region.name;
            zones.insert(region.name);
        } else if (region.objectKind != 3 && region.objectKind != 4 && region.objectKind != 5) {
            vmallocSites.insert(region.name);
        }
    }
    ASSERT_FALSE(zones.empty());

    const auto categories = kernelCategories(run.out);
    ASSERT_FALSE(categories.empty()) << run.out;
    uint64_t slab = 0, vmalloc = 0;
    for (const auto &[name, row] : categories) {
        const bool zone = zones.count(name) != 0, site = vmallocSites.count(name) != 0;
        if (zone && !site) {
            slab += row.dirty + row.reclaimable;
            EXPECT_EQ(row.clean, 0u) << name;
        } else if (site && !zone) {
            vmalloc += row.dirty;
        }
    }
    EXPECT_TRUE(reconciles("slab zones, dirty plus reclaimable", slab, slabBefore, slabAfter, 0.05));
    if (vmallocBefore > 0 && vmallocAfter > 0) {
        EXPECT_TRUE(reconciles("vmalloc areas", vmalloc, vmallocBefore, vmallocAfter, 0.03));
    }
    // Counters are reported beside the tables, not as regions.
    EXPECT_NE(run.out.find("Auxiliary data:\n\tMaps:\n"), std::string::npos) << run.out;
    EXPECT_NE(run.out.find("\t\tVM_KERN_COUNT_MAP_ZONE: "), std::string::npos) << run.out;
    RecordProperty("slab_bytes", std::to_string(slab));
    RecordProperty("meminfo_slab_bytes", std::to_string(slabAfter));
    RecordProperty("vmalloc_bytes", std::to_string(vmalloc));
    RecordProperty("meminfo_vmalloc_bytes", std::to_string(vmallocAfter));
}

TEST(KernelRun, AllProcessesIncludeTheKernelWhichSharesWithNoOne) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    auto run = runProgram({"-a", "-f", "bytes"});
    ASSERT_EQ(run.status, 0) << run.err;
    const size_t header = run.out.find("\nkernel [0]: 64-bit\tVestage: ");
    ASSERT_NE(header, std::string::npos) << run.out;
    // The kernel's section runs from its header to the next one's rule.
    const size_t rule = run.out.find('\n', run.out.find("\n====", header + 1) + 1);
    const size_t next = run.out.find("\n====", rule);
    const std::string section = run.out.substr(header, next == std::string::npos ? std::string::npos : next - header);
    EXPECT_EQ(section.find("Shared with"), std::string::npos) << section;
    EXPECT_EQ(section.find("Errors were encountered"), std::string::npos) << section;
}

TEST(KernelRun, WithoutPrivilegeTheKernelCarriesTheSystemsReason) {
    // As root the run drops to an unprivileged user through setpriv.
    std::vector<std::string> args = {"-p", "0"};
    std::string program = VESTAGE_TEST_BIN_DIR "/vestage";
    if (geteuid() == 0) {
        program = "/usr/bin/setpriv";
        if (access(program.c_str(), X_OK) != 0) GTEST_SKIP() << "no setpriv to drop root with";
        args.insert(args.begin(), {"--reuid=65534", "--regid=65534", "--clear-groups", "--inh-caps=-all",
                                   VESTAGE_TEST_BIN_DIR "/vestage"});
    }
    auto run = runProgram(args, {}, program);
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.err, "kernel [0]: kernel_memory_info: Permission denied\n");
    EXPECT_NE(run.out.find("\tkernel [0]: Permission denied\n"), std::string::npos) << run.out;
    EXPECT_NE(run.out.find("Errors were encountered while examining the following processes:\n\tkernel\n"),
              std::string::npos)
        << run.out;
}

}  // namespace
