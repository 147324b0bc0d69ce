// The text report byte for byte: whole driver runs over prepared targets.

#include "output/openmetrics_formatter.h"
#include "output/visible_text.h"
#include "tests/report/report_support.h"

using namespace report_test;

TEST(TextReport, ProcessSectionsInTwoFormats) {
    const std::string bytesWide =
        rule(90) + "daemon [42]: 64-bit\tVestage: 9502720 B (16384 bytes per page)\n" + rule(90) +
        "\n"
        "      Dirty     (Swapped)         Clean   Reclaimable       (Wired)    Regions    Category\n"
        "        ---           ---           ---           ---           ---        ---    ---\n"
        "  9437184 B     1048576 B           0 B           0 B           0 B          2    MALLOC_SMALL\n"
        "    65536 B           0 B       16384 B           0 B       16384 B          3    stack\n"
        "        ---           ---           ---           ---           ---        ---    ---\n"
        "  9502720 B     1048576 B       16384 B           0 B       16384 B          5    TOTAL\n"
        "\n";
    for (const auto &[format, options, expected] :
         {std::tuple<std::int64_t, std::int64_t, std::string>{VSSummaryFormatFormatted, 0, kDaemonFormatted},
          {VSSummaryFormatBytes, VSOutputOptionSwapped | VSOutputOptionWired, bytesWide}}) {
        ReportRun run;
        addDaemon(run);  // a single process: no summary follows
        EXPECT_EQ(run.report(format, options), expected);
    }
}

TEST(TextReport, FailedAndWarnedProcessesThenDiagnosticsAndSummary) {
    ReportRun run;
    addTroubledRun(run);
    const std::string tableHead = "\n"
                                  "  Dirty      Clean  Reclaimable    Regions    Category\n"
                                  "    ---        ---          ---        ---    ---\n";
    const std::string kernelAux = "\tKernel memory:\n\t\tKPRVT: 16 KB\n\t\tdeeper:\n\t\t\tx: 0 B\n";
    const std::string daemonSection = kDaemonFormatted + "Auxiliary data:\n" + kernelAux + "\tphys_vestage: 10 KB\n\n";
    EXPECT_EQ(run.report(), daemonSection + rule() +
                                "worker [7]: 64-bit\n"
                                "Errors were encountered while examining the process. No results gathered.\n"
                                "\tworker [7]: task is gone\n" +
                                rule() + "\n" + rule() +
                                "tool [5]: 32-bit\n"
                                "Warnings were encountered while examining the process.\n"
                                "\ttool [5]: (zombie)\n"
                                "\tVestage: 16 KB (16384 bytes per page)\n" +
                                rule() + tableHead +
                                "  16 KB        0 B          0 B          1    stack\n"
                                "    ---        ---          ---        ---    ---\n"
                                "  16 KB        0 B          0 B          1    TOTAL\n"
                                "\n\n"
                                "Warnings were encountered while examining the following processes:\n\ttool\n\n"
                                "Errors were encountered while examining the following processes:\n\tworker\n\n"
                                "Due to errors, summary results may be invalid\n"
                                "Physical Vestage Breakdown: Enabled\n" +
                                rule() + "Summary Vestage: 17 MB (may be invalid due to errors)\n" + rule() +
                                tableHead +
                                "  17 MB        0 B          0 B          3    MALLOC_SMALL\n"
                                " 144 KB      32 KB          0 B          6    stack\n"
                                "    ---        ---          ---        ---    ---\n"
                                "  17 MB      32 KB          0 B          9    TOTAL\n"
                                "\nAuxiliary data:\n" +
                                kernelAux + "\n");
}

TEST(TextReport, RegionListingWithBothOptionalColumns) {
    PreparedProcess daemon(42, "daemon", 16384, true);
    daemon
        .region({.name = "MALLOC_SMALL", .objectId = 0x1a2b3c4d5e6f, .start = 0x104f80000, .size = 8 * MiB,
                 .dirty = 7 * MiB, .swapped = MiB})
        .region({.name = "stack", .objectId = 0x7f01, .start = 0x16b000000, .size = 512 * KiB, .dirty = 64 * KiB,
                 .clean = 16 * KiB, .wired = 16 * KiB});
    daemon.gatherData();
    std::vector<const VSMemoryRegion *> regions;
    for (const auto &region : daemon.memoryRegions()) {
        regions.push_back(region.get());
    }
    VSOutputFormatterText text(VSSummaryFormatFormatted, VSOutputOptionSwapped | VSOutputOptionWired);
    testing::internal::CaptureStdout();
    text.printSpanlistLikeOutputForProcess(daemon, regions);
    EXPECT_EQ(testing::internal::GetCapturedStdout(),
              "daemon [42]\n"
              "\n"
              "           start                end  [objectid]      VRT     DRT     SWP     CLN     RCL    WIRE   "
              "tag (detail)\n"
              "      ----------         ----------  ----------    -----   -----   -----   -----   -----   -----   "
              "------------\n"
              "       104f80000 -        105780000 [2b3c4d5e6f]     512     512      64       0       0       0   "
              "MALLOC_SMALL \n"
              "       16b000000 -        16b080000 [      7f01]      32       4       0       1       0       1   "
              "stack \n"
              "\n");
}

// Names come from other users: nothing in them may act on the terminal or forge a report line. Printable UTF-8
// passes; control bytes, C1 controls, bytes that are not UTF-8 and the escape character itself are escaped.
TEST(TextReport, NamesFromOtherUsersCannotActOnTheTerminal) {
    const std::pair<std::string, std::string> cases[] = {
        {"café ☕ /usr/lib/x86_64-linux-gnu/libc.so.6", "café ☕ /usr/lib/x86_64-linux-gnu/libc.so.6"},
        {"\x1b]0;owned\x07tab\there", "\\x1b]0;owned\\x07tab\\there"},
        {"two\nlines\r", "two\\nlines\\r"},
        {"C1 \xc2\x9b" "2J, DEL \x7f", "C1 \\xc2\\x9b2J, DEL \\x7f"},
        {"not UTF-8 \xff, overlong \xc0\xaf, surrogate \xed\xa0\x80, cut \xe2\x98", "not UTF-8 \\xff, overlong "
                                                                                   "\\xc0\\xaf, surrogate \\xed\\xa0"
                                                                                   "\\x80, cut \\xe2\\x98"},
        {"back\\slash", "back\\\\slash"},
    };
    for (const auto &[name, shown] : cases) {
        EXPECT_EQ(vs::visibleText(name), shown);
        EXPECT_EQ(vs::isVisibleText(name), name == shown) << shown;
    }

    const std::string evil = "evil\x1b[2J\nVestage: 0 B";
    ReportRun run;
    run.process(9, evil).region({.name = "mapped file /tmp/\x1b]0;pwned\x07", .objectId = 1, .dirty = 16 * KiB});
    run.process(8, "victim").region({.name = "mapped file /tmp/\x1b]0;pwned\x07", .objectId = 1, .dirty = 16 * KiB});
    run.process(7, "other").error(evil + " [9]: gone\n");
    run.gather();
    std::vector<const VSMemoryRegion *> regions;
    for (const auto &region : run.vestage->processes()[0]->memoryRegions()) {
        regions.push_back(region.get());
    }
    VSOutputFormatterText listing(VSSummaryFormatFormatted, 0);
    testing::internal::CaptureStdout();
    listing.printSpanlistLikeOutputForProcess(*run.vestage->processes()[0], regions);
    std::string text = testing::internal::GetCapturedStdout();
    text += run.report();
    EXPECT_EQ(text.find('\x1b'), std::string::npos) << text;
    EXPECT_EQ(text.find("\nVestage: 0 B"), std::string::npos) << text;
    for (const char *line : {"evil\\x1b[2J\\nVestage: 0 B [9]\n",                   // -v listing
                             "evil\\x1b[2J\\nVestage: 0 B [9]: 64-bit\tVestage",    // process header
                             "Shared with evil\\x1b[2J\\nVestage: 0 B [9]:\n",       // the victim's shared table
                             "mapped file /tmp/\\x1b]0;pwned\\x07\n",               // category
                             "\tevil\\x1b[2J\\nVestage: 0 B [9]: gone\\n\n",         // an error naming it
                             "processes:\n\tother\n"}) {
        EXPECT_NE(text.find(line), std::string::npos) << line << "\n" << text;
    }
}

namespace {

// Label values as scrapers read them back: the three escapes, and bytes
// that are not UTF-8 replaced rather than passed on.
TEST(OpenMetricsText, LabelValuesAreEscaped) {
    const std::pair<std::string, std::string> cases[] = {
        {"worker", "worker"},
        {"say \"hi\"", "say \\\"hi\\\""},
        {"C:\\dir", "C:\\\\dir"},
        {"two\nlines", "two\\nlines"},
        {"mem\xff" "child", "mem\xEF\xBF\xBD" "child"},
        {"caf\xC3\xA9", "caf\xC3\xA9"},
    };
    for (const auto &[name, expected] : cases) {
        EXPECT_EQ(VSOutputFormatterOpenMetrics::labelValue(name), expected) << name;
    }
}

}  // namespace
