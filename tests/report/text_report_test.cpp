// The text report byte for byte: whole driver runs over prepared targets,
// compared with reference texts.

#include <gtest/gtest.h>

#include "tests/report/report_support.h"

using namespace report_test;

namespace {

// MALLOC_SMALL: 8 MiB dirty and 1 MiB swapped in two regions; stack: 64 KiB
// dirty, 16 KiB clean and 16 KiB wired in three.
PreparedProcess &addDaemon(ReportRun &run) {
    return run.process(42, "daemon")
        .region({.name = "MALLOC_SMALL", .objectId = 1, .dirty = 4 * MiB, .swapped = 512 * KiB})
        .region({.name = "MALLOC_SMALL", .objectId = 2, .dirty = 4 * MiB, .swapped = 512 * KiB})
        .region({.name = "stack", .objectId = 3, .dirty = 64 * KiB})
        .region({.name = "stack", .objectId = 4, .clean = 16 * KiB, .wired = 16 * KiB})
        .region({.name = "stack", .objectId = 5});
}

const std::string kDaemonFormatted = rule() +
                                     "daemon [42]: 64-bit\tVestage: 9280 KB (16384 bytes per page)\n" + rule() +
                                     "\n"
                                     "  Dirty      Clean  Reclaimable    Regions    Category\n"
                                     "    ---        ---          ---        ---    ---\n"
                                     "9216 KB        0 B          0 B          2    MALLOC_SMALL\n"
                                     "  64 KB      16 KB          0 B          3    stack\n"
                                     "    ---        ---          ---        ---    ---\n"
                                     "9280 KB      16 KB          0 B          5    TOTAL\n"
                                     "\n";

} // namespace

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
    struct Case {
        std::int64_t format, options;
        std::string expected;
    } cases[] = {
        {VSSummaryFormatFormatted, 0, kDaemonFormatted},
        {VSSummaryFormatBytes, VSOutputOptionSwapped | VSOutputOptionWired, bytesWide},
    };
    for (const Case &c : cases) {
        ReportRun run;
        addDaemon(run);
        // A single process: no summary and no merged auxiliary data follow.
        EXPECT_EQ(run.report(c.format, c.options), c.expected);
    }
}

TEST(TextReport, RunWithAFailedProcessEndsWithDiagnosticsAndSummary) {
    ReportRun run;
    addDaemon(run);
    // Same memory, without the swapped part; its vestage is smaller.
    run.process(7, "worker")
        .region({.name = "MALLOC_SMALL", .objectId = 11, .dirty = 4 * MiB})
        .region({.name = "MALLOC_SMALL", .objectId = 12, .dirty = 4 * MiB})
        .region({.name = "stack", .objectId = 13, .dirty = 64 * KiB})
        .region({.name = "stack", .objectId = 14, .clean = 16 * KiB})
        .region({.name = "stack", .objectId = 15})
        .error("worker [7]: task is gone");
    const std::string expected = kDaemonFormatted + rule() +
                                 "worker [7]: 64-bit\n"
                                 "Errors were encountered while examining the process. No results gathered.\n"
                                 "\tworker [7]: task is gone\n" +
                                 rule() + "\n" +
                                 "\n"
                                 "Errors were encountered while examining the following processes:\n"
                                 "\tworker\n"
                                 "\n"
                                 "Due to errors, summary results may be invalid\n" +
                                 rule() + "Summary Vestage: 17 MB (may be invalid due to errors)\n" + rule() +
                                 "\n"
                                 "  Dirty      Clean  Reclaimable    Regions    Category\n"
                                 "    ---        ---          ---        ---    ---\n"
                                 "  17 MB        0 B          0 B          4    MALLOC_SMALL\n"
                                 " 128 KB      32 KB          0 B          6    stack\n"
                                 "    ---        ---          ---        ---    ---\n"
                                 "  17 MB      32 KB          0 B         10    TOTAL\n"
                                 "\n";
    EXPECT_EQ(run.report(), expected);
}

TEST(TextReport, SizeTexts) {
    struct Case {
        std::int64_t format;
        std::uint64_t pageSize, size;
        const char *expected;
    } cases[] = {
        {VSSummaryFormatBytes, 0, 0, "0 B"},          {VSSummaryFormatFormatted, 0, 0, "0 B"},
        {VSSummaryFormatFormatted, 0, 9999, "9999 B"}, {VSSummaryFormatFormatted, 0, 10000, "10 KB"},
        {VSSummaryFormatFormatted, 0, 1048575, "1024 KB"}, {VSSummaryFormatFormatted, 0, 123456789, "118 MB"},
        {VSSummaryFormatPages, 16384, 0, "0 pages"},   {VSSummaryFormatPages, 16384, 1, "1 pages"},
        {VSSummaryFormatPages, 16384, 16385, "2 pages"},
        // Before the first process header there is no page size to count in.
        {VSSummaryFormatPages, 0, 16384, "0 pages"},
    };
    for (const Case &c : cases) {
        VSOutputFormatterText text(c.format, 0);
        text.setPageSize(c.pageSize);
        EXPECT_EQ(text.formattedStringForSize(c.size), c.expected) << c.format << " " << c.size;
    }
}

TEST(TextReport, PagesFormatCountsLaterFiguresInTheLastHeaderPages) {
    ReportRun run;
    run.process(1, "small", 4096).region({.objectId = 1, .dirty = 64 * KiB});
    run.process(2, "big", 16384).region({.objectId = 2, .dirty = 32 * KiB});
    const std::string report = run.report(VSSummaryFormatPages);
    EXPECT_NE(report.find("small [1]: 64-bit\tVestage: 16 pages (4096 bytes per page)\n"), std::string::npos);
    EXPECT_NE(report.find("Summary Vestage: 6 pages\n"), std::string::npos) << report;
}

TEST(TextReport, WarningsPutTheVestageOnALineOfItsOwn) {
    ReportRun run;
    run.process(5, "tool", 16384, false).region({.objectId = 1, .dirty = 16 * KiB}).warning("tool [5]: (zombie)");
    const std::string expected = rule() +
                                 "tool [5]: 32-bit\n"
                                 "Warnings were encountered while examining the process.\n"
                                 "\ttool [5]: (zombie)\n"
                                 "\tVestage: 16 KB (16384 bytes per page)\n" +
                                 rule() + "\n  Dirty  ";
    const std::string report = run.report();
    EXPECT_EQ(report.substr(0, expected.size()), expected);
    // Warnings alone do not make the results doubtful.
    EXPECT_EQ(report.find("Due to errors"), std::string::npos);
}

TEST(TextReport, SharedWithLines) {
    struct Case {
        int others;
        const char *line;
    } cases[] = {
        {1, "Shared with p [1001]:\n"},
        {2, "Shared with p [1001], p [1002]:\n"},
        {19, "Shared with p [1001], p [1002], p [1003], p [1004], p [1005], p [1006], p [1007], p [1008], "
             "p [1009], p [1010], p [1011], p [1012], p [1013], p [1014], p [1015], p [1016], p [1017], "
             "p [1018], p [1019]:\n"},
        {20, "Shared with 21 processes:\n"},
    };
    for (const Case &c : cases) {
        ReportRun run;
        // Listed first (highest pid, same vestage); all of its memory is shared.
        run.process(2000, "self").region({.name = "shm", .objectId = 7, .dirty = 16 * KiB});
        for (int i = c.others; i >= 1; --i) {
            run.process(1000 + i, "p").region({.name = "shm", .objectId = 7, .dirty = 16 * KiB});
        }
        const std::string expected = rule() + "self [2000]: 64-bit\tVestage: 16 KB (16384 bytes per page)\n" +
                                     rule() + "\n" + c.line +
                                     "  Dirty      Clean  Reclaimable    Regions    Category\n";
        EXPECT_EQ(run.report().substr(0, expected.size()), expected);
    }
}

TEST(TextReport, GlobalErrorsAndTheBreakdownNoteLeadIntoTheSummary) {
    ReportRun run;
    run.fake.setting("vm.self_region_vestage", 1);
    run.process(1, "a").region({.objectId = 1, .dirty = 16 * KiB});
    run.process(2, "b").region({.objectId = 2, .dirty = 16 * KiB});
    run.gather();
    VSProcess::_addGlobalError("something global");
    // The note goes to standard output itself, so the report goes there too.
    run.vestage->addOutputFormatter(std::make_unique<VSOutputFormatterText>(VSSummaryFormatFormatted, 0));
    testing::internal::CaptureStdout();
    run.vestage->printOutputVerbose(false, false);
    const std::string report = testing::internal::GetCapturedStdout();
    const std::string expected = "\nErrors were encountered:\n\tsomething global\n"
                                 "\nDue to errors, summary results may be invalid\n"
                                 "Physical Vestage Breakdown: Enabled\n" +
                                 rule() + "Summary Vestage: 32 KB (may be invalid due to errors)\n";
    EXPECT_NE(report.find(expected), std::string::npos) << report;
}

TEST(TextReport, AuxiliaryData) {
    using vs::makeAuxData, vs::makeAuxDictionary;
    auto auxOf = [](std::int64_t kernel) {
        return makeAuxDictionary({
            {"Kernel memory", makeAuxDictionary({{"KPRVT", makeAuxData(kernel, true)},
                                                 {"deeper", makeAuxDictionary({{"x", makeAuxData(0, true)}})}})},
            {"phys_vestage", makeAuxData(10000, false)},
        });
    };
    ReportRun run;
    run.process(3, "a").region({.objectId = 1, .dirty = 64 * KiB}).aux(auxOf(16384));
    run.process(2, "b").region({.objectId = 2, .dirty = 32 * KiB}).aux(makeAuxDictionary({}));
    run.process(1, "c").region({.objectId = 3, .dirty = 16 * KiB}).aux(auxOf(1 << 20)).error("x");
    const std::string report = run.report();
    EXPECT_NE(report.find("TOTAL\n\n"
                          "Auxiliary data:\n"
                          "\tKernel memory:\n"
                          "\t\tKPRVT: 16 KB\n"
                          "\t\tdeeper:\n"
                          "\t\t\tx: 0 B\n"
                          "\tphys_vestage: 10 KB\n"
                          "\n"),
              std::string::npos)
        << report;
    // An empty dictionary still prints its title.
    EXPECT_NE(report.find("TOTAL\n\nAuxiliary data:\n\n" + rule()), std::string::npos) << report;
    // Merged over the healthy processes only, non-aggregating figures gone.
    const std::string tail = "TOTAL\n\nAuxiliary data:\n\tKernel memory:\n\t\tKPRVT: 16 KB\n\t\tdeeper:\n\t\t\tx: 0 B\n\n";
    EXPECT_EQ(report.substr(report.size() - tail.size()), tail);
}

TEST(TextReport, RegionListingWithBothOptionalColumns) {
    PreparedProcess daemon(42, "daemon", 16384, true);
    VSMemoryRegion heap;
    heap.setName("MALLOC_SMALL");
    heap.setStart(0x104f80000);
    heap.setSize(8 * MiB);
    heap.setObject_id(0x1a2b3c4d5e6f);
    heap.setDirtySize(7 * MiB);
    heap.setSwappedSize(1 * MiB);
    VSMemoryRegion stack;
    stack.setName("stack");
    stack.setStart(0x16b000000);
    stack.setSize(512 * KiB);
    stack.setObject_id(0x7f01);
    stack.setDirtySize(64 * KiB);
    stack.setCleanNonSpecSize(16 * KiB);
    stack.setWiredSize(16 * KiB);

    CapturedStream output;
    VSOutputFormatterText text(VSSummaryFormatFormatted, VSOutputOptionSwapped | VSOutputOptionWired);
    text.setOutput(output.stream());
    text.printSpanlistLikeOutputForProcess(daemon, {&heap, &stack});
    EXPECT_EQ(output.text(),
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
