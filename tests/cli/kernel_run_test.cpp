// The running kernel (pid 0): its slab zones and vmalloc areas add up to
// what the kernel itself states in /proc/meminfo.

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <array>
#include <fstream>
#include <map>
#include <regex>
#include <set>
#include <sstream>

#include "tests/support/run_program.h"

namespace {

using vs::test::runProgram;

// Bytes of a "Name:   123 kB" line of /proc/meminfo.
int64_t meminfoBytes(const std::string &name) {
    std::ifstream in("/proc/meminfo");
    for (std::string line; std::getline(in, line);) {
        if (line.rfind(name + ":", 0) == 0) return std::stoll(line.substr(name.size() + 1)) * 1024;
    }
    return 0;
}

// Whether `value` lies within `slack` (a fraction) of the two readings' range.
::testing::AssertionResult reconciles(uint64_t value, int64_t before, int64_t after, double slack) {
    const auto v = static_cast<double>(value);
    return (v >= std::min(before, after) * (1.0 - slack) && v <= std::max(before, after) * (1.0 + slack)
                ? ::testing::AssertionSuccess()
                : ::testing::AssertionFailure())
           << value << " bytes; meminfo: " << before << ", then " << after;
}

// What every kernel keeps true: the kernel target's figures and the
// processes' share (AnonPages + Mapped) are all the memory in use
// (MemTotal - MemFree), its slab rows are meminfo's Slab, its vmalloc rows
// VmallocUsed. Read before and after the run, so the drift between the two
// readings is allowed and nothing else is.
TEST(KernelRun, KernelFiguresAndProcessesAddUpToTheMemoryInUse) {
    if (geteuid() != 0) GTEST_SKIP() << "the kernel's memory files are readable by root only";
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    // An instrumented program maps terabytes of shadow memory: the kernel
    // memory that takes while it runs is more than any reading around the
    // run can see, and the books are then off by tens of MiB.
    GTEST_SKIP() << "the program under test is built with a sanitizer";
#endif
    auto inUse = [] { return meminfoBytes("MemTotal") - meminfoBytes("MemFree"); };
    auto processes = [] { return meminfoBytes("AnonPages") + meminfoBytes("Mapped"); };
    // What the rest of the machine does meanwhile shows as the spread of a
    // few readings on either side of the run; that much is allowed.
    int64_t noise = 0;
    auto spread = [&noise, &inUse, &processes] {
        int64_t low = INT64_MAX, high = INT64_MIN;
        for (int i = 0; i < 5; ++i) {
            const int64_t kernelShare = inUse() - processes();
            low = std::min(low, kernelShare), high = std::max(high, kernelShare);
            usleep(2000);
        }
        noise = std::max(noise, high - low);
    };
    spread();
    const int64_t usedBefore = inUse(), processesBefore = processes(), slabBefore = meminfoBytes("Slab"),
                  vmallocBefore = meminfoBytes("VmallocUsed");
    auto run = runProgram({"-p", "0", "-v", "-f", "bytes"});
    const int64_t usedAfter = inUse(), processesAfter = processes(), slabAfter = meminfoBytes("Slab"),
                  vmallocAfter = meminfoBytes("VmallocUsed");
    spread();
    ASSERT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.err, "");

    // Kinds (bits 32-39 of the object id): zones 2, then tags, counters and
    // modules; every other kind is a code-address site. A name on both sides
    // would blur the sums and is left out.
    std::set<std::string> zones, sites;
    const std::regex regionLine(R"(^ *[0-9a-f]+ - +[0-9a-f]+ \[ *([0-9a-f]+)\] +\d+ +\d+ +\d+ +\d+   )"
                                R"((.*?)( zone| \(user wired\)| \(hidden\))? ?$)");
    const std::regex row(R"(^ *(\d+) B +(\d+) B +(\d+) B +\d+    (.*)$)");
    std::map<std::string, std::array<uint64_t, 3>> categories;  // dirty, clean, reclaimable
    std::array<uint64_t, 3> total{};
    std::istringstream lines(run.out);
    for (std::string line; std::getline(lines, line);) {
        std::smatch m;
        if (std::regex_match(line, m, regionLine)) {
            const uint64_t kind = (std::stoull(m[1], nullptr, 16) >> 32) & 0xFF;
            if (kind == 2) {
                EXPECT_EQ(m[3], " zone") << line;
                zones.insert(m[2]);
            } else if (kind < 2 || kind > 5) {
                sites.insert(m[2]);
            }
        } else if (std::regex_match(line, m, row)) {
            const std::array<uint64_t, 3> figures = {std::stoull(m[1]), std::stoull(m[2]), std::stoull(m[3])};
            if (m[4] == "TOTAL") {
                if (total == std::array<uint64_t, 3>{}) total = figures;  // the first table is the kernel's own
            } else {
                categories[m[4]] = figures;
            }
        }
    }
    ASSERT_FALSE(zones.empty()) << run.out;
    ASSERT_EQ(categories.count("unnamed kernel memory"), 1u) << "shown even when small: " << run.out;

    const int64_t kernel = static_cast<int64_t>(total[0] + total[1] + total[2]);
    // The run itself holds kernel memory while it reads (its page tables,
    // slab objects of its open files) that neither reading sees: a little
    // room for that, a fixed share of the memory in use.
    const int64_t runOwnMemory = std::max(usedBefore, usedAfter) / 200;
    const int64_t drift =
        std::abs(usedAfter - usedBefore) + std::abs(processesAfter - processesBefore) + runOwnMemory + 2 * noise;
    const int64_t low = std::min(usedBefore - processesBefore, usedAfter - processesAfter) - drift;
    const int64_t high = std::max(usedBefore - processesBefore, usedAfter - processesAfter) + drift;
    EXPECT_GE(kernel, low) << run.out;
    EXPECT_LE(kernel, high) << run.out;

    uint64_t slab = categories.count("slab outside caches") ? categories["slab outside caches"][0] +
                                                                  categories["slab outside caches"][2]
                                                            : 0;
    uint64_t vmalloc = 0;
    for (const auto &[name, figures] : categories) {
        const bool zone = zones.count(name) != 0, site = sites.count(name) != 0;
        if (zone && !site) {
            slab += figures[0] + figures[2];
            EXPECT_EQ(figures[1], 0u) << name;
        } else if (site && !zone) {
            vmalloc += figures[0];
        }
    }
    const int64_t slabDrift = std::abs(slabAfter - slabBefore) + runOwnMemory;
    EXPECT_GE(static_cast<int64_t>(slab), std::min(slabBefore, slabAfter) - slabDrift);
    EXPECT_LE(static_cast<int64_t>(slab), std::max(slabBefore, slabAfter) + slabDrift);
    if (vmallocBefore > 0 && vmallocAfter > 0) {
        EXPECT_TRUE(reconciles(vmalloc, vmallocBefore, vmallocAfter, 0.03));
    }
    // Counters are reported beside the tables, not as regions.
    EXPECT_NE(run.out.find("Auxiliary data:\n\tMaps:\n"), std::string::npos) << run.out;
    EXPECT_NE(run.out.find("\t\tVM_KERN_COUNT_MAP_ZONE: "), std::string::npos) << run.out;
}

}  // namespace
