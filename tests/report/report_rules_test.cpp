// Rules of the text report that a whole report must keep, each a case with
// what must and must not appear: object names, the shared-table titles,
// folding through the driver, page sizes per section, which diagnostics
// invalidate the summary, auxiliary blocks.

#include <gtest/gtest.h>

#include "model/aux_data.h"
#include "tests/report/report_support.h"

namespace {

using namespace report_test;

TEST(ReportRules, WholeReports) {
    struct Case {
        const char *what;
        std::function<void(ReportRun &)> arrange;
        std::int64_t format;
        bool summarize;
        std::vector<std::string> present, absent;
    };
    // n processes sharing one object, named p1 [1] .. pn [n].
    auto sharing = [](int n) {
        return [n](ReportRun &run) {
            for (int pid = 1; pid <= n; ++pid) {
                run.process(pid, "p" + std::to_string(pid)).region({.name = "pool", .objectId = 7, .dirty = MiB});
            }
        };
    };
    const Case cases[] = {
        {"an object is named after the first region filed in it",
         [](ReportRun &run) {
             run.process(1, "one")
                 .region({.name = "first", .objectId = 5, .dirty = MiB})
                 .region({.name = "second", .objectId = 5, .dirty = MiB, .offset = 32 * MiB});
         },
         VSSummaryFormatFormatted, false, {"    first\n"}, {"second"}},
        {"three sharers are listed with commas", sharing(4), VSSummaryFormatFormatted, false,
         {"Shared with p2 [2], p3 [3], p4 [4]:\n", "Shared with p1 [1], p2 [2], p3 [3]:\n"}, {}},
        {"20 sharers are still named", sharing(20), VSSummaryFormatFormatted, false, {"p19 [19], p20 [20]:\n"},
         {"Shared with 20 processes:"}},
        {"21 sharers are counted", sharing(21), VSSummaryFormatFormatted, false, {"Shared with 21 processes:\n"},
         {"p20 [20], p21 [21]:"}},
        {"a sharer mapping the object twice is named once",
         [](ReportRun &run) {
             run.process(1, "one").region({.name = "pool", .objectId = 7, .dirty = MiB});
             run.process(2, "two")
                 .region({.name = "pool", .objectId = 7, .dirty = MiB})
                 .region({.name = "gap", .objectId = 8, .dirty = MiB})
                 .region({.name = "pool", .objectId = 7, .dirty = MiB, .offset = 32 * MiB});
         },
         VSSummaryFormatFormatted, false, {"Shared with two [2]:\n"}, {"two [2], two [2]"}},
        {"-y folds small categories of every table, through the driver",
         [](ReportRun &run) {
             run.process(1, "one")
                 .region({.name = "big", .objectId = 1, .dirty = 4 * MiB})
                 .region({.name = "tiny", .objectId = 2, .dirty = 16 * KiB, .segment = VSSegmentData});
         },
         VSSummaryFormatFormatted, true, {"    Other\n", "    big\n"}, {"tiny"}},
        {"pages are counted in each section's own page size",
         [](ReportRun &run) {
             run.process(2, "small", 4096).region({.name = "a", .objectId = 1, .dirty = 64 * KiB});
             run.process(1, "large", 16384).region({.name = "b", .objectId = 2, .dirty = 64 * KiB});
         },
         VSSummaryFormatPages, false, {"Vestage: 16 pages (4096 bytes per page)", "Vestage: 4 pages (16384 bytes"}, {}},
        {"warnings leave the summary valid",
         [](ReportRun &run) {
             run.process(1, "one").region({.name = "a", .objectId = 1, .dirty = MiB}).warning("one [1]: went away");
             run.process(2, "two").region({.name = "b", .objectId = 2, .dirty = MiB});
         },
         VSSummaryFormatFormatted, false, {"Warnings were encountered", "Summary Vestage: 2048 KB\n"},
         {"may be invalid"}},
        {"errors make it invalid",
         [](ReportRun &run) {
             run.process(1, "one").error("one [1]: refused");
             run.process(2, "two").region({.name = "b", .objectId = 2, .dirty = MiB});
         },
         VSSummaryFormatFormatted, false, {"(may be invalid due to errors)"}, {}},
        {"an empty auxiliary dictionary prints its title",
         [](ReportRun &run) {
             run.process(1, "one").region({.name = "a", .objectId = 1, .dirty = MiB}).aux(vs::makeAuxDictionary({}));
         },
         VSSummaryFormatFormatted, false, {"TOTAL\n\nAuxiliary data:\n\n"}, {}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        ReportRun run;
        c.arrange(run);
        const std::string report = run.report(c.format, 0, nullptr, c.summarize);
        for (const std::string &text : c.present) {
            EXPECT_NE(report.find(text), std::string::npos) << "missing: " << text << "\n" << report;
        }
        for (const std::string &text : c.absent) {
            EXPECT_EQ(report.find(text), std::string::npos) << "present: " << text << "\n" << report;
        }
    }
}

} // namespace
