// The analysis behind the report: objects, vestage, groups, folding, interruption.

#include <map>
#include <set>

#include "tests/report/report_support.h"

using namespace report_test;

namespace {

std::string pidsText(const VSProcessGroup &group) {
    std::string text;
    for (const VSProcess *member : group) {
        text += (text.empty() ? "" : ",") + std::to_string(member->pid());
    }
    return "{" + text + "}";
}

std::map<std::int32_t, std::uint64_t> sortedVestage(const VSVestage &vestage) {
    return {vestage.pidToVestage().begin(), vestage.pidToVestage().end()};
}

} // namespace

TEST(Merging, RegionsBecomeMemoryObjectsByKey) {
    const std::uint8_t cow = vs::kShareModeCopyOnWrite;
    const std::uint64_t cache = 0x180000000;
    struct Case {
        const char *label;
        RegionSpec first, second;  // of two targets
        bool secondIs64, oneObject;
        std::vector<std::size_t> collections;  // ordinary, text, cache 64, cache 32, unique
    } cases[] = {
        {"one object", {.objectId = 9}, {.objectId = 9}, true, true, {1, 0, 0, 0, 0}},
        {"copy-on-write, dirty in both", {.objectId = 9, .dirty = 1, .shareMode = cow},
         {.objectId = 9, .dirty = 1, .shareMode = cow}, true, false, {2, 0, 0, 0, 0}},
        {"copy-on-write, only swapped in both", {.objectId = 9, .swapped = 1, .shareMode = cow},
         {.objectId = 9, .swapped = 1, .shareMode = cow}, true, false, {2, 0, 0, 0, 0}},
        {"copy-on-write, untouched", {.objectId = 9, .clean = 1, .shareMode = cow},
         {.objectId = 9, .clean = 1, .shareMode = cow}, true, true, {1, 0, 0, 0, 0}},
        {"no object id", {}, {}, true, false, {0, 0, 0, 0, 2}},
        {"text and ordinary with one id", {.objectId = 9, .segment = VSSegmentText}, {.objectId = 9}, true, false,
         {1, 1, 0, 0, 0}},
        {"shared cache keyed by start", {.objectId = 1, .start = cache, .inSharedCache = true},
         {.objectId = 2, .start = cache, .inSharedCache = true}, true, true, {0, 0, 1, 0, 0}},
        {"shared cache of 32 and 64 bits", {.start = cache, .inSharedCache = true},
         {.start = cache, .inSharedCache = true}, false, false, {0, 0, 1, 1, 0}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ReportRun run;
        run.process(1, "a").region(c.first);
        run.process(2, "b", 16384, c.secondIs64).region(c.second);
        const VSVestage &v = run.gather();
        const VSMemoryObject *first = v.processes()[0]->memoryRegions()[0]->memoryObject();
        ASSERT_NE(first, nullptr);
        EXPECT_EQ(first == v.processes()[1]->memoryRegions()[0]->memoryObject(), c.oneObject);
        EXPECT_EQ((std::vector<std::size_t>{v.memoryObjects().size(), v.textMemoryObjects().size(),
                                            v.sharedCache64MemoryObjects().size(),
                                            v.sharedCache32MemoryObjects().size(), v.uniqueMemoryObjects().size()}),
                  c.collections);
    }
    // A pid-2 process's private copy-on-write key equals a kernel zone's object id.
    ReportRun run;
    run.process(0, "kernel").region({.objectId = 0x200000005, .dirty = 1});
    run.process(2, "worker").region({.objectId = 5, .dirty = 1, .shareMode = vs::kShareModeCopyOnWrite});
    const VSVestage &v = run.gather();
    EXPECT_NE(v.processes()[0]->memoryRegions()[0]->memoryObject(),
              v.processes()[1]->memoryRegions()[0]->memoryObject());
    EXPECT_EQ(v.kernelMemoryObjects().size(), 1u);
}

TEST(Vestage, ChargesDistinctObjectsAndOrdersTargets) {
    ReportRun run;
    std::vector<std::int32_t> started;
    auto note = [&started](std::int32_t pid) { return [&started, pid] { started.push_back(pid); }; };
    // One object through three regions at different offsets counts once.
    run.process(10, "ten")
        .region({.objectId = 1, .dirty = 16 * KiB})
        .region({.objectId = 1, .dirty = 16 * KiB, .offset = 16 * MiB})
        .region({.objectId = 1, .swapped = 16 * KiB, .clean = MiB, .offset = 32 * MiB})
        .onGather(note(10));
    // An object shared by two targets counts in full for each.
    run.process(30, "thirty").region({.objectId = 2, .dirty = 8 * MiB, .wired = MiB}).onGather(note(30));
    run.process(40, "forty").region({.objectId = 2, .dirty = 8 * MiB}).onGather(note(40));
    run.process(20, "twenty").region({.objectId = 3, .dirty = 48 * KiB}).onGather(note(20));
    run.process(5, "five").onGather(note(5));
    const VSVestage &vestage = run.gather(1);

    EXPECT_EQ(started, (std::vector<std::int32_t>{40, 30, 20, 10, 5}));
    EXPECT_EQ(sortedVestage(vestage), (std::map<std::int32_t, std::uint64_t>{
                                          {10, 48 * KiB}, {20, 48 * KiB}, {30, 8 * MiB}, {40, 8 * MiB}, {5, 0}}));
    std::vector<std::int32_t> listed;
    for (const VSProcess *process : vestage._getProcessListSortedByVestage()) {
        listed.push_back(process->pid());
    }
    // Equal vestage: higher pid first; nothing mapped: last.
    EXPECT_EQ(listed, (std::vector<std::int32_t>{40, 30, 20, 10, 5}));
}

TEST(Sharing, ProcessGroups) {
    struct Case {
        const char *label;
        std::vector<std::pair<std::int32_t, std::vector<RegionSpec>>> targets;
        std::map<std::string, std::set<std::string>> objectsByGroup;
        std::map<std::int32_t, std::uint64_t> vestage;
    };
    const RegionSpec a{.name = "a", .objectId = 1, .dirty = 1}, b{.name = "b", .objectId = 2, .dirty = 2};
    const RegionSpec x{.name = "x", .objectId = 3, .dirty = 4}, y{.name = "y", .objectId = 4, .dirty = 8};
    const RegionSpec xAgain{.name = "x", .objectId = 3, .dirty = 4, .offset = 16 * MiB};
    const Case cases[] = {
        {"private and shared memory", {{1, {a, x}}, {2, {b, x}}}, {{"{1}", {"a"}}, {"{2}", {"b"}}, {"{1,2}", {"x"}}},
         {{1, 5}, {2, 6}}},
        {"a pair and a triple stay apart", {{1, {x, y}}, {2, {x, y}}, {3, {y}}}, {{"{1,2}", {"x"}}, {"{1,2,3}", {"y"}}},
         {{1, 12}, {2, 12}, {3, 8}}},
        {"one object mapped twice by one target", {{1, {x, xAgain}}, {2, {}}}, {{"{1}", {"x"}}}, {{1, 8}, {2, 0}}},
        // Two heapfiles of one process: one member, one vestage entry (the later).
        {"two targets with one pid", {{5, {x}}, {5, {x, y}}}, {{"{5}", {"x", "y"}}}, {{5, 12}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ReportRun run;
        for (const auto &[pid, regions] : c.targets) {
            PreparedProcess &process = run.process(pid, "p");
            for (const RegionSpec &shape : regions) {
                process.region(shape);
            }
        }
        const VSVestage &vestage = run.gather();
        const std::unique_ptr<VSVestageSharingData> sharing = vestage._sharingData();
        std::map<std::string, std::set<std::string>> objectsByGroup;
        for (const auto &[group, objects] : sharing->processGroupToObjects()) {
            for (const VSMemoryObject *object : objects) {
                objectsByGroup[pidsText(group)].insert(object->name().value_or("?"));
            }
        }
        EXPECT_EQ(objectsByGroup, c.objectsByGroup);
        EXPECT_EQ(sortedVestage(vestage), c.vestage);
    }
}

TEST(Categories, FoldingIntoOther) {
    const std::pair<RegionSpec, bool> entries[] = {  // the region, whether it folds
        {{.name = "text at the limit", .dirty = MiB, .segment = VSSegmentText}, true},
        {{.name = "text above the limit", .dirty = MiB + 1, .segment = VSSegmentText}, false},
        {{.name = "data, swapped", .swapped = 512 * KiB, .segment = VSSegmentData}, true},
        {{.name = "big linkedit", .dirty = 2 * MiB, .segment = VSSegmentLinkedit}, false},
        {{.name = "mapped file", .clean = 4 * MiB}, true},
        {{.name = "purgeable, clean", .clean = 16 * KiB, .purgeableNonVolatile = true}, false},
        {{.name = "purgeable, empty", .purgeableNonVolatile = true}, true},
        {{.name = "small anonymous", .dirty = 16 * KiB}, false},
    };
    ReportRun run;
    PreparedProcess &process = run.process(1, "p");
    std::uint64_t objectId = 100;
    std::set<std::string> kept{"Other"};
    for (auto [shape, folds] : entries) {
        shape.objectId = objectId++;
        process.region(shape);
        if (!folds) {
            kept.insert(shape.name);
        }
    }
    // A second region of a folded object: "Other" counts the object once.
    process.region({.name = "mapped file", .objectId = 104, .clean = 4 * MiB});
    const VSCategoryTable all = run.gather()._categoriesForAllProcesses();

    VSCategoryTotals plainTotals, foldedTotals;
    EXPECT_EQ(VSVestage::_summarizedCategoriesForCategories(all, false, plainTotals).size(), std::size(entries));
    const VSCategoryTable folded = VSVestage::_summarizedCategoriesForCategories(all, true, foldedTotals);
    std::set<std::string> foldedNames;
    for (const auto &entry : folded) {
        foldedNames.insert(entry.first);
    }
    EXPECT_EQ(foldedNames, kept);
    const VSMemoryCategory &other = folded.at("Other");
    EXPECT_EQ(std::tuple(other.totalDirtySize(), other.totalSwappedSize(), other.totalCleanSize()),
              std::tuple(MiB, 512 * KiB, 4 * MiB));
    EXPECT_EQ(other.totalRegions(), 5);
    // Folding moves figures around; the totals stay.
    EXPECT_TRUE(plainTotals == foldedTotals);
    EXPECT_EQ(plainTotals.regions, 9u);
}

// Cancelled while the highest pid gathers: no other target starts.
TEST(Gathering, InterruptSkipsTargetsThatHaveNotStarted) {
    ReportRun run;
    for (std::int32_t pid : {10, 30, 20}) {
        run.process(pid, "p" + std::to_string(pid))
            .region({.objectId = static_cast<std::uint64_t>(pid), .dirty = 16 * KiB})
            .onGather([&run, pid] {
                if (pid == 30) {
                    run.vestage->cancel();
                }
            });
    }
    const VSVestage &vestage = run.gather(1);
    EXPECT_EQ(sortedVestage(vestage), (std::map<std::int32_t, std::uint64_t>{{10, 0}, {20, 0}, {30, 16 * KiB}}));
    const std::string report = run.report();
    EXPECT_NE(report.find("\nErrors were encountered:\n"
                          "\tVestage exited early due to SIGINT and did not finish gathering all data\n"
                          "\nDue to errors, summary results may be invalid\n" +
                          rule() + "Summary Vestage: 16 KB (may be invalid due to errors)\n"),
              std::string::npos)
        << report;
    EXPECT_LT(report.find("p30 [30]"), report.find("p20 [20]"));
    EXPECT_LT(report.find("p20 [20]"), report.find("p10 [10]"));
}
