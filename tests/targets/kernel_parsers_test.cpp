// The kernel-wide /proc parsers on damaged input: lines the kernel would never print are skipped, and a file cut
// anywhere (a read racing a writer) yields the entries before the cut.

#include <fcntl.h>
#include <gtest/gtest.h>

#include <functional>

#include "targets/platform/linux/kernel_text.h"
#include "targets/platform/linux/proc_reader.h"

namespace {

using Entries = std::vector<std::string>;

// Each parser's entries as comparable text.
template <class Parsed, class Text>
std::function<Entries(std::string_view)> entries(Parsed (*parse)(std::string_view), Text text) {
    return [=](std::string_view input) {
        Entries out;
        for (const auto &entry : parse(input)) out.push_back(text(entry));
        return out;
    };
}
const auto meminfo = entries(vs::parseMeminfo, [](const auto &e) { return e.name + " " + std::to_string(e.bytes); });
const auto slabinfo = entries(vs::parseSlabinfo, [](const auto &c) {
    return c.name + " " + std::to_string(c.activeObjects) + " " + std::to_string(c.objectSize) + " " +
           std::to_string(c.pagesPerSlab) + " " + std::to_string(c.slabs);
});

TEST(KernelParsers, MalformedLinesAreSkipped) {
    EXPECT_EQ(meminfo("MemTotal:       1000 kB\nno colon here 5 kB\n: 7 kB\nEmpty:\nLetters:   12a kB\n"
                      "Negative:  -3 kB\nHugePages_Total:       4\nOdd:   9 MB\n\nLast:  2 kB"),
              (Entries{"MemTotal 1024000", "HugePages_Total 4", "Odd 9", "Last 2048"}));
    EXPECT_EQ(slabinfo("slabinfo - version: 2.1\nkmalloc-64 x 8 64 64 1 : tunables 0 0 0 : slabdata 3 4 0\n"
                       "kmalloc-32 8 8 32 128 1 ; tunables 0 0 0 : slabdata 3 4 0\n"
                       "kmalloc-8 8 8 8 512 1 : tunables 0 0 0 : slabdata 1 1 0"),
              (Entries{"kmalloc-8 8 8 1 1"}));
}

TEST(KernelParsers, CapturesCutAnywhereKeepTheEntriesBeforeTheCut) {
    for (const auto &[file, parse] : std::vector<std::pair<const char *, std::function<Entries(std::string_view)>>>{
             {"linux_slabinfo.txt", slabinfo}, {"linux_meminfo.txt", meminfo}}) {
        const std::string path = std::string(VESTAGE_TEST_DATA_DIR) + "/" + file;
        std::string_view view;
        ASSERT_EQ(vs::readFileAt(AT_FDCWD, path.c_str(), view), 0) << path;
        const std::string text(view);
        const Entries whole = parse(text);
        ASSERT_FALSE(whole.empty()) << file;
        for (size_t cut = 0; cut <= text.size(); ++cut) {
            const Entries part = parse(std::string_view(text).substr(0, cut));
            ASSERT_LE(part.size(), whole.size()) << file << " cut at " << cut;
            // Only the entry on the cut line may differ (a number cut short).
            for (size_t i = 0; i + 1 < part.size(); ++i) {
                ASSERT_EQ(part[i], whole[i]) << file << " cut at " << cut;
            }
        }
    }
}

}  // namespace
