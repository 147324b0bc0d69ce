// The kernel-wide /proc parsers on damaged input: lines the kernel would
// never print are skipped, and a file cut anywhere (a read racing a
// writer, a short buffer) yields the entries before the cut.

#include <gtest/gtest.h>

#include <fcntl.h>

#include <functional>
#include <string>
#include <vector>

#include "targets/platform/linux/kernel_text.h"
#include "targets/platform/linux/proc_reader.h"

namespace {

std::string capture(const char *name) {
    const std::string path = std::string(VESTAGE_TEST_DATA_DIR) + "/" + name;
    std::string_view text;
    EXPECT_EQ(vs::readFileAt(AT_FDCWD, path.c_str(), text), 0) << path;
    return std::string(text);
}

TEST(KernelParsers, MalformedMeminfoAndKallsymsLinesAreSkipped) {
    const auto meminfo = vs::parseMeminfo(
        "MemTotal:       1000 kB\n"
        "no colon here 5 kB\n"
        ": 7 kB\n"                  // no name
        "Empty:\n"                  // no value
        "Letters:   12a kB\n"       // not a number
        "Negative:  -3 kB\n"
        "HugePages_Total:       4\n"  // a count, no unit
        "Odd:   9 MB\n"             // unknown unit: the number as it stands
        "\n"
        "Last:  2 kB");             // no final newline
    std::vector<std::pair<std::string, uint64_t>> got;
    for (const auto &e : meminfo) got.emplace_back(e.name, e.bytes);
    const std::vector<std::pair<std::string, uint64_t>> expected = {
        {"MemTotal", 1000 * 1024}, {"HugePages_Total", 4}, {"Odd", 9}, {"Last", 2048}};
    EXPECT_EQ(got, expected);

    const auto symbols = vs::parseKallsyms(
        "ffffffff81000000 T _stext\n"
        "ffffffff81000100\n"                      // no type, no name
        "ffffffff81000200 TT double_type\n"
        "zzzzzzzzzzzzzzzz T not_hex\n"
        "1ffffffff81000300 T seventeen_digits\n"
        "ffffffff81000400 D data_symbol\n"
        "ffffffff81000500 t local_text [module]\n"
        "ffffffff81000050 W weak_text");
    std::vector<std::pair<uint64_t, std::string>> names;
    for (const auto &s : symbols) names.emplace_back(s.address, s.name);
    const std::vector<std::pair<uint64_t, std::string>> expectedNames = {
        {0xffffffff81000000, "_stext"}, {0xffffffff81000050, "weak_text"}, {0xffffffff81000500, "local_text"}};
    EXPECT_EQ(names, expectedNames);

    const auto slabs = vs::parseSlabinfo(
        "slabinfo - version: 2.1\n"
        "kmalloc-64 x 8 64 64 1 : tunables 0 0 0 : slabdata 3 4 0\n"   // active count not a number
        "kmalloc-32 8 8 32 128 1 ; tunables 0 0 0 : slabdata 3 4 0\n"  // wrong separator
        "kmalloc-16 8 8 16 256 1 : tunables 0 0 0 : slabdata 3 -4 0\n"
        "kmalloc-8 8 8 8 512 1 : tunables 0 0 0 : slabdata 1 1 0");
    ASSERT_EQ(slabs.size(), 1u);
    EXPECT_EQ(slabs[0].name, "kmalloc-8");

    const auto vmalloc = vs::parseVmallocinfo(
        "0x1-0x2 8192 f+0x1/0x2 pages=x vmalloc\n"
        "0x3-0x4 8192 f+0x1/0x2 pages= vmalloc\n"
        "0x5-0x6\n"
        "0x7-0x8 8192 g+0x1/0x2 pages=1 vmalloc N0=1");
    ASSERT_EQ(vmalloc.size(), 1u);
    EXPECT_EQ(vmalloc[0].caller, "g+0x1/0x2");
}

TEST(KernelParsers, CapturesCutAnywhereKeepTheEntriesBeforeTheCut) {
    struct Case {
        const char *file;
        // Parses and returns one comparable text per entry, in file order.
        std::function<std::vector<std::string>(std::string_view)> parse;
    };
    const std::vector<Case> cases = {
        {"linux_slabinfo.txt",
         [](std::string_view t) {
             std::vector<std::string> out;
             for (const auto &c : vs::parseSlabinfo(t)) {
                 out.push_back(c.name + " " + std::to_string(c.activeObjects) + " " + std::to_string(c.objectSize) +
                               " " + std::to_string(c.pagesPerSlab) + " " + std::to_string(c.slabs));
             }
             return out;
         }},
        {"linux_meminfo.txt",
         [](std::string_view t) {
             std::vector<std::string> out;
             for (const auto &e : vs::parseMeminfo(t)) out.push_back(e.name + " " + std::to_string(e.bytes));
             return out;
         }},
        {"linux_vmallocinfo.txt",
         [](std::string_view t) {
             std::vector<std::string> out;
             for (const auto &c : vs::parseVmallocinfo(t)) out.push_back(c.caller);
             return out;
         }},
    };
    for (const Case &c : cases) {
        const std::string text = capture(c.file);
        const std::vector<std::string> whole = c.parse(text);
        ASSERT_FALSE(whole.empty()) << c.file;
        for (size_t cut = 0; cut <= text.size(); ++cut) {
            const std::vector<std::string> part = c.parse(std::string_view(text).substr(0, cut));
            ASSERT_LE(part.size(), whole.size()) << c.file << " cut at " << cut;
            // Only the entry on the cut line may differ (a number cut short).
            for (size_t i = 0; i + 1 < part.size(); ++i) {
                ASSERT_EQ(part[i], whole[i]) << c.file << " cut at " << cut;
            }
        }
    }
    // kallsyms is sorted on the way out; a cut file just has fewer symbols.
    const std::string kallsyms = capture("linux_kallsyms.txt");
    const size_t all = vs::parseKallsyms(kallsyms).size();
    for (size_t cut = 0; cut <= kallsyms.size(); ++cut) {
        ASSERT_LE(vs::parseKallsyms(std::string_view(kallsyms).substr(0, cut)).size(), all) << cut;
    }
}

}  // namespace
