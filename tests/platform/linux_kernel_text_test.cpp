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
