// Parsers of the kernel-wide memory files on captures of a test machine's
// slabinfo and vmallocinfo (damaged input and meminfo are
// covered in tests/targets/kernel_parsers_test.cpp).

#include "targets/platform/linux/kernel_text.h"
#include "targets/platform/linux/proc_reader.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <map>
#include <string>
#include <tuple>

namespace {

std::string readData(const char *name) {
    const std::string path = std::string(VESTAGE_TEST_DATA_DIR) + "/" + name;
    std::string_view text;
    EXPECT_EQ(vs::readFileAt(AT_FDCWD, path.c_str(), text), 0) << path;
    return std::string(text);
}

TEST(LinuxKernelText, Captures) {
    const auto caches = vs::parseSlabinfo(readData("linux_slabinfo.txt"));
    ASSERT_EQ(caches.size(), 28u) << "the two header lines are not caches";
    const vs::SlabCache &bio = caches[3];
    EXPECT_EQ(std::make_tuple(bio.name, bio.activeObjects, bio.objectSize, bio.pagesPerSlab, bio.slabs),
              std::make_tuple(std::string("bio-376"), uint64_t{21}, uint64_t{384}, uint64_t{2}, uint64_t{1}));

    // Summed per caller; two call sites of one function stay apart; ioremap
    // areas are device memory and left out.
    std::map<std::string, std::pair<uint64_t, uint64_t>> byCaller; // pages, areas
    for (const vs::VmallocCaller &c : vs::parseVmallocinfo(readData("linux_vmallocinfo.txt"))) {
        EXPECT_TRUE(byCaller.emplace(c.caller, std::make_pair(c.pages, c.areas)).second) << c.caller;
    }
    const std::map<std::string, std::pair<uint64_t, uint64_t>> expected = {
        {"kernel_clone+0x94/0x3e0", {68, 17}},     {"bpf_prog_alloc_no_stats+0x39/0x230", {16, 15}},
        {"bpf_prog_realloc+0x62/0xf0", {2, 1}},    {"htab_map_alloc+0x2e4/0x5a0", {577, 1}},
        {"pcpu_create_chunk+0x80/0x230", {9, 1}}, {"pcpu_create_chunk+0xa0/0x230", {2, 1}},
    };
    EXPECT_EQ(byCaller, expected);
}

TEST(LinuxKernelText, CallersAndModules) {
    const std::tuple<const char *, bool, const char *, uint64_t> splits[] = {
        {"kernel_clone+0x94/0x3e0", true, "kernel_clone", 0x94},
        {"a+b+0x10/0x20", true, "a+b", 0x10},
        {"vm_area", false, "", 0},
    };
    for (const auto &[caller, ok, expectedSymbol, expectedOffset] : splits) {
        std::string_view symbol;
        uint64_t offset = 0;
        ASSERT_EQ(vs::splitCaller(caller, symbol, offset), ok) << caller;
        EXPECT_TRUE(!ok || (symbol == expectedSymbol && offset == expectedOffset)) << caller;
    }
    const auto modules = vs::parseModules("ext4 745472 1 - Live 0xffffffffc0a00000\n"
                                          "crc16 12288 1 ext4, Live 0x0000000000000000\nbroken line\n");
    ASSERT_EQ(modules.size(), 2u);
    EXPECT_EQ(modules[0].name + " " + std::to_string(modules[0].size), "ext4 745472");
    EXPECT_EQ(modules[0].address, 0xffffffffc0a00000u);
    EXPECT_EQ(modules[1].address, 0u);
}

} // namespace

namespace {

TEST(LinuxKernelText, PerCpuFreePagesAreTheCountsOfThePagesets) {
    // A capture of this machine: three zones, two CPUs; 56647 pages parked.
    EXPECT_EQ(vs::parsePerCpuFreePages(readData("linux_zoneinfo.txt")), 56647u);
    // Only pageset counts: a zone statistic that happens to be called
    // count elsewhere, or a count before any pagesets line, is not one.
    EXPECT_EQ(vs::parsePerCpuFreePages("Node 0, zone DMA\n  count: 5\n  pagesets\n    cpu: 0\n"
                                       "              count:    7\nNode 0, zone Normal\n  count: 9\n"),
              7u);
}

TEST(LinuxKernelText, KernelBooksAddUpToTheMemoryInUse) {
    constexpr uint64_t MiB = 1 << 20;
    auto used = [](const vs::KernelBooksInput &in) { return in.memTotal - in.memFree; };
    struct Case {
        const char *what;
        vs::KernelBooksInput in;
        vs::KernelBooks expected;
    };
    vs::KernelBooksInput typical;
    typical.memTotal = 1000 * MiB;
    typical.memFree = 400 * MiB;
    typical.anonPages = 100 * MiB;
    typical.mapped = 50 * MiB;
    typical.cached = 200 * MiB;
    typical.buffers = 20 * MiB;
    typical.shmem = 30 * MiB;
    typical.dirty = 4 * MiB;
    typical.writeback = 1 * MiB;
    typical.sReclaimable = 60 * MiB;
    typical.sUnreclaim = 30 * MiB;
    typical.zones = 80 * MiB;
    typical.reclaimableZones = 55 * MiB;
    typical.otherListed = 40 * MiB;
    typical.perCpuFree = 10 * MiB;
    vs::KernelBooksInput crowded = typical; // the kernel's own figures overshoot
    crowded.memFree = 700 * MiB;
    vs::KernelBooksInput huge = typical;
    huge.memFree = 100 * MiB;
    huge.hugetlb = 256 * MiB;
    huge.hugePageSize = 2 * MiB;
    huge.hugePagesTotal = 128;
    huge.hugePagesFree = 32;
    const std::vector<Case> cases = {
        // slab: 5 reclaimable + 5 unreclaimable outside the caches; cache no
        // process maps: 220 - 50 = 170, of which 5 dirty and at most 30 tmpfs.
        {"typical", typical, {10 * MiB, 5 * MiB, 140 * MiB, 5 * MiB, 30 * MiB, 10 * MiB, 0, 140 * MiB, false}},
        {"named beyond what is used: nothing left, and said so", crowded,
         {10 * MiB, 5 * MiB, 140 * MiB, 5 * MiB, 30 * MiB, 10 * MiB, 0, 0, true}},
        {"huge pages: the unused pool is listed, those in use are the processes'", huge,
         {10 * MiB, 5 * MiB, 140 * MiB, 5 * MiB, 30 * MiB, 10 * MiB, 64 * MiB, 184 * MiB, false}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const vs::KernelBooks books = vs::closeKernelBooks(c.in);
        const auto fields = [](const vs::KernelBooks &b) {
            return std::make_tuple(b.slabOutsideCaches, b.slabOutsideCachesReclaimable, b.unmappedPageCache,
                                   b.unmappedPageCacheDirty, b.unmappedTmpfs, b.perCpuFree, b.unusedHugetlb,
                                   b.unnamed, b.unnamedClamped);
        };
        EXPECT_EQ(fields(books), fields(c.expected));
        if (!books.unnamedClamped) {
            // The books close: every byte in use is in exactly one place.
            const uint64_t total = c.in.anonPages + c.in.mapped + c.in.zones + c.in.otherListed +
                                   books.slabOutsideCaches + books.unmappedPageCache + books.unmappedTmpfs +
                                   books.perCpuFree + (c.in.hugetlb - books.unusedHugetlb) + books.unusedHugetlb +
                                   books.unnamed;
            EXPECT_EQ(total, used(c.in));
        }
    }
}

} // namespace
