// Parsers of the kernel-wide memory files, on captures of this machine's
// slabinfo, vmallocinfo, kallsyms and meminfo and on small edge cases.

#include "targets/platform/linux/kernel_text.h"
#include "targets/platform/linux/proc_reader.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <map>
#include <string>

namespace {

std::string readData(const char *name) {
    const std::string path = std::string(VESTAGE_TEST_DATA_DIR) + "/" + name;
    std::string_view text;
    EXPECT_EQ(vs::readFileAt(AT_FDCWD, path.c_str(), text), 0) << path;
    return std::string(text);
}

TEST(LinuxKernelText, SlabinfoCapture) {
    const auto caches = vs::parseSlabinfo(readData("linux_slabinfo.txt"));
    ASSERT_EQ(caches.size(), 28u) << "the two header lines are not caches";
    EXPECT_EQ(caches[0].name, "btrfs_delayed_node");
    EXPECT_EQ(caches[0].slabs, 0u);
    struct Expect {
        size_t index;
        const char *name;
        uint64_t active, objectSize, pagesPerSlab, slabs;
    };
    const Expect expected[] = {
        {2, "bio-312", 12, 320, 1, 1},
        {3, "bio-376", 21, 384, 2, 1},
    };
    for (const Expect &e : expected) {
        const vs::SlabCache &c = caches[e.index];
        EXPECT_EQ(c.name, e.name);
        EXPECT_EQ(c.activeObjects, e.active) << e.name;
        EXPECT_EQ(c.objectSize, e.objectSize) << e.name;
        EXPECT_EQ(c.pagesPerSlab, e.pagesPerSlab) << e.name;
        EXPECT_EQ(c.slabs, e.slabs) << e.name;
    }
    // A line cut short or without the slabdata part is no cache.
    const auto damaged = vs::parseSlabinfo("x 1 2 3 4 5 : tunables 0 0 0 : slabdata 1\n"
                                           "y 1 2 3 4 5\n"
                                           "z 7 8 64 64 1 : tunables 0 0 0 : slabdata 3 4 0");
    ASSERT_EQ(damaged.size(), 1u);
    EXPECT_EQ(damaged[0].name, "z");
    EXPECT_EQ(damaged[0].slabs, 4u);
}

TEST(LinuxKernelText, VmallocinfoSummedPerCaller) {
    const auto callers = vs::parseVmallocinfo(readData("linux_vmallocinfo.txt"));
    std::map<std::string, std::pair<uint64_t, uint64_t>> byCaller; // pages, areas
    for (const vs::VmallocCaller &c : callers) {
        EXPECT_EQ(byCaller.count(c.caller), 0u) << "one entry per caller: " << c.caller;
        byCaller[c.caller] = {c.pages, c.areas};
    }
    const std::map<std::string, std::pair<uint64_t, uint64_t>> expected = {
        {"kernel_clone+0x94/0x3e0", {68, 17}},
        {"bpf_prog_alloc_no_stats+0x39/0x230", {16, 15}},
        {"bpf_prog_realloc+0x62/0xf0", {2, 1}},
        {"htab_map_alloc+0x2e4/0x5a0", {577, 1}},
        // Two call sites of one function stay apart.
        {"pcpu_create_chunk+0x80/0x230", {9, 1}},
        {"pcpu_create_chunk+0xa0/0x230", {2, 1}},
    };
    EXPECT_EQ(byCaller, expected) << "ioremap areas are device memory and left out";

    const auto edge = vs::parseVmallocinfo(
        "0x1-0x2    8192 unpurged vm_area\n"
        "0x3-0x4   20480 irq_init_percpu_irqstack+0xca/0x100 vmap\n"
        "0x5-0x6    8192 acpi_os_map_iomem+0x1bc/0x1e0 phys=0x00000000000a0000 ioremap\n"
        "0x7-0x8   12288 f+0x1/0x2 pages=2 vmalloc N0=2");
    ASSERT_EQ(edge.size(), 1u) << "only areas with pages and a caller count";
    EXPECT_EQ(edge[0].caller, "f+0x1/0x2");
    EXPECT_EQ(edge[0].pages, 2u);

    struct SplitCase {
        const char *caller;
        bool ok;
        const char *symbol;
        uint64_t offset;
    };
    const SplitCase splits[] = {
        {"kernel_clone+0x94/0x3e0", true, "kernel_clone", 0x94},
        {"a+b+0x10/0x20", true, "a+b", 0x10},
        {"vm_area", false, "", 0},
        {"+0x1/0x2", false, "", 0},
        {"f+zz/0x2", false, "", 0},
    };
    for (const SplitCase &c : splits) {
        std::string_view symbol;
        uint64_t offset = 0;
        EXPECT_EQ(vs::splitCaller(c.caller, symbol, offset), c.ok) << c.caller;
        if (c.ok) {
            EXPECT_EQ(symbol, c.symbol);
            EXPECT_EQ(offset, c.offset);
        }
    }
}

TEST(LinuxKernelText, KallsymsAndModules) {
    const auto symbols = vs::parseKallsyms(readData("linux_kallsyms.txt"));
    ASSERT_FALSE(symbols.empty());
    for (size_t i = 1; i < symbols.size(); ++i) {
        EXPECT_LE(symbols[i - 1].address, symbols[i].address);
    }
    auto find = [&](const char *name) -> uint64_t {
        for (const vs::KernelSymbol &s : symbols) {
            if (s.name == name) {
                return s.address;
            }
        }
        return 0;
    };
    EXPECT_EQ(find("kernel_clone"), 0xffffffff81358590u);
    EXPECT_EQ(find("pcpu_create_chunk"), 0xffffffff815c6070u) << "local text symbols count";
    EXPECT_EQ(find("ftrace_trampoline"), 0xffffffffc0201000u) << "module symbols keep their name";

    // Without privilege every address reads 0: no symbols at all, rather
    // than every address naming the first one.
    EXPECT_TRUE(vs::parseKallsyms("0000000000000000 T _stext\n0000000000000000 t f\n").empty());
    EXPECT_TRUE(vs::parseKallsyms("ffffffff81000000 D data_only\n").empty());

    const auto modules = vs::parseModules("ext4 745472 1 - Live 0xffffffffc0a00000\n"
                                          "crc16 12288 1 ext4, Live 0x0000000000000000\n"
                                          "broken line\n");
    ASSERT_EQ(modules.size(), 2u);
    EXPECT_EQ(modules[0].name, "ext4");
    EXPECT_EQ(modules[0].size, 745472u);
    EXPECT_EQ(modules[0].address, 0xffffffffc0a00000u);
    EXPECT_EQ(modules[1].address, 0u);
}

TEST(LinuxKernelText, Meminfo) {
    const auto entries = vs::parseMeminfo(readData("linux_meminfo.txt"));
    std::map<std::string, uint64_t> values;
    for (const vs::MeminfoEntry &e : entries) {
        values[e.name] = e.bytes;
    }
    EXPECT_EQ(entries.front().name, "MemTotal") << "file order is kept";
    EXPECT_EQ(values["MemTotal"], 24684084ull * 1024);
    EXPECT_EQ(values["KernelStack"], 2312ull * 1024);
    EXPECT_EQ(values["Mlocked"], 19004ull * 1024);
    EXPECT_EQ(values.count("HugePages_Total"), 1u);
    EXPECT_EQ(values["HugePages_Total"], 0u) << "counts without a unit stay counts";
}

} // namespace
