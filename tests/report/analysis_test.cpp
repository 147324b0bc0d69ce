// The analysis behind the report: which regions become one memory object,
// what each target is charged and in which order targets come, how memory
// splits into process groups, how categories fold and sort, and the order
// in which the formatters are called.

#include <gtest/gtest.h>

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

std::string namesText(const VSSortedCategoryKeys &keys) {
    std::string text;
    for (const std::string &key : keys) {
        text += (text.empty() ? "" : ",") + key;
    }
    return "[" + text + "]";
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
        RegionSpec first, second;
        bool sameTarget, secondIs64, oneObject;
        std::vector<std::size_t> collections;  // ordinary, text, linkedit, cache 64, cache 32, unique
    } cases[] = {
        {"two targets map one object", {.objectId = 9}, {.objectId = 9}, false, true, true, {1, 0, 0, 0, 0, 0}},
        {"copy-on-write, dirty in both", {.objectId = 9, .dirty = 1, .shareMode = cow},
         {.objectId = 9, .dirty = 1, .shareMode = cow}, false, true, false, {2, 0, 0, 0, 0, 0}},
        {"copy-on-write, swapped in both", {.objectId = 9, .swapped = 1, .shareMode = cow},
         {.objectId = 9, .swapped = 1, .shareMode = cow}, false, true, false, {2, 0, 0, 0, 0, 0}},
        {"copy-on-write, untouched", {.objectId = 9, .clean = 1, .shareMode = cow},
         {.objectId = 9, .clean = 1, .shareMode = cow}, false, true, true, {1, 0, 0, 0, 0, 0}},
        {"copy-on-write, dirty twice in one target", {.objectId = 9, .dirty = 1, .shareMode = cow},
         {.objectId = 9, .dirty = 1, .shareMode = cow}, true, true, true, {1, 0, 0, 0, 0, 0}},
        {"no object id", {}, {}, false, true, false, {0, 0, 0, 0, 0, 2}},
        {"text and ordinary with one id", {.objectId = 9, .segment = VSSegmentText}, {.objectId = 9}, false, true,
         false, {1, 1, 0, 0, 0, 0}},
        {"linkedit with one id", {.objectId = 9, .segment = VSSegmentLinkedit},
         {.objectId = 9, .segment = VSSegmentLinkedit}, false, true, true, {0, 0, 1, 0, 0, 0}},
        {"data merges with ordinary", {.objectId = 9, .segment = VSSegmentData}, {.objectId = 9}, false, true, true,
         {1, 0, 0, 0, 0, 0}},
        {"shared cache keyed by start", {.objectId = 1, .start = cache, .inSharedCache = true},
         {.objectId = 2, .start = cache, .inSharedCache = true}, false, true, true, {0, 0, 0, 1, 0, 0}},
        {"shared cache of 32 and 64 bits", {.start = cache, .inSharedCache = true},
         {.start = cache, .inSharedCache = true}, false, false, false, {0, 0, 0, 1, 1, 0}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ReportRun run;
        PreparedProcess &a = run.process(1, "a");
        a.region(c.first);
        (c.sameTarget ? a : run.process(2, "b", 16384, c.secondIs64)).region(c.second);
        const VSVestage &v = run.gather();
        const VSMemoryRegion &first = *v.processes()[0]->memoryRegions()[0];
        const VSMemoryRegion &second = *v.processes().back()->memoryRegions().back();
        ASSERT_NE(first.memoryObject(), nullptr);
        EXPECT_EQ(first.memoryObject() == second.memoryObject(), c.oneObject);
        EXPECT_EQ((std::vector<std::size_t>{v.memoryObjects().size(), v.textMemoryObjects().size(),
                                            v.linkeditMemoryObjects().size(), v.sharedCache64MemoryObjects().size(),
                                            v.sharedCache32MemoryObjects().size(), v.uniqueMemoryObjects().size()}),
                  c.collections);
    }
}

// A process in a pid namespace can have pid 2; the private key of its dirty
// copy-on-write region then equals a kernel zone's made-up object id.
TEST(Merging, KernelObjectsNeverMergeWithProcessObjects) {
    ReportRun run;
    run.process(0, "kernel").region({.objectId = 0x200000005, .dirty = 1});
    run.process(2, "worker").region({.objectId = 5, .dirty = 1, .shareMode = vs::kShareModeCopyOnWrite});
    const VSVestage &v = run.gather();
    EXPECT_NE(v.processes()[0]->memoryRegions()[0]->memoryObject(), v.processes()[1]->memoryRegions()[0]->memoryObject());
    EXPECT_EQ(v.kernelMemoryObjects().size(), 1u);
    EXPECT_EQ(v.memoryObjects().size(), 1u);
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
    // One worker makes the start order observable.
    const VSVestage &vestage = run.gather(1);

    EXPECT_EQ(started, (std::vector<std::int32_t>{40, 30, 20, 10, 5}));
    const std::map<std::int32_t, std::uint64_t> expected = {
        {10, 48 * KiB}, {20, 48 * KiB}, {30, 8 * MiB}, {40, 8 * MiB}, {5, 0}};
    EXPECT_EQ(sortedVestage(vestage), expected);
    std::vector<std::int32_t> listed;
    for (const VSProcess *process : vestage._getProcessListSortedByVestage()) {
        listed.push_back(process->pid());
    }
    // Equal vestage: higher pid first; nothing mapped: last.
    EXPECT_EQ(listed, (std::vector<std::int32_t>{40, 30, 20, 10, 5}));
}

TEST(Sharing, ProcessGroups) {
    struct Target {
        std::int32_t pid;
        std::vector<RegionSpec> regions;
    };
    struct Case {
        const char *label;
        std::vector<Target> targets;
        std::map<std::string, std::set<std::string>> objectsByGroup;
        std::map<std::int64_t, std::set<std::string>> groupsByPid;
        std::map<std::int32_t, std::uint64_t> vestage;
    };
    const RegionSpec a{.name = "a", .objectId = 1, .dirty = 1}, b{.name = "b", .objectId = 2, .dirty = 2};
    const RegionSpec x{.name = "x", .objectId = 3, .dirty = 4}, y{.name = "y", .objectId = 4, .dirty = 8};
    const RegionSpec xAgain{.name = "x", .objectId = 3, .dirty = 4, .offset = 16 * MiB};
    const Case cases[] = {
        {"private and shared memory", {{1, {a, x}}, {2, {b, x}}},
         {{"{1}", {"a"}}, {"{2}", {"b"}}, {"{1,2}", {"x"}}}, {{1, {"{1}", "{1,2}"}}, {2, {"{2}", "{1,2}"}}},
         {{1, 5}, {2, 6}}},
        {"a pair and a triple stay apart", {{1, {x, y}}, {2, {x, y}}, {3, {y}}},
         {{"{1,2}", {"x"}}, {"{1,2,3}", {"y"}}},
         {{1, {"{1,2}", "{1,2,3}"}}, {2, {"{1,2}", "{1,2,3}"}}, {3, {"{1,2,3}"}}}, {{1, 12}, {2, 12}, {3, 8}}},
        {"one object mapped twice by one target", {{1, {x, xAgain}}, {2, {y}}}, {{"{1}", {"x"}}, {"{2}", {"y"}}},
         {{1, {"{1}"}}, {2, {"{2}"}}}, {{1, 8}, {2, 8}}},
        // Two heapfiles of one process: one member, one vestage entry (the later).
        {"two targets with one pid", {{5, {x}}, {5, {x, y}}}, {{"{5}", {"x", "y"}}}, {{5, {"{5}"}}}, {{5, 12}}},
        {"a target that maps nothing", {{1, {x}}, {2, {}}}, {{"{1}", {"x"}}}, {{1, {"{1}"}}}, {{1, 4}, {2, 0}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ReportRun run;
        for (const Target &target : c.targets) {
            PreparedProcess &process = run.process(target.pid, "p");
            for (const RegionSpec &shape : target.regions) {
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
        std::map<std::int64_t, std::set<std::string>> groupsByPid;
        for (const auto &[pid, groups] : sharing->processToProcessGroups()) {
            for (const VSProcessGroup &group : groups) {
                groupsByPid[pid].insert(pidsText(group));
            }
        }
        EXPECT_EQ(groupsByPid, c.groupsByPid);
        EXPECT_EQ(sortedVestage(vestage), c.vestage);
    }
}

TEST(Categories, FoldingIntoOther) {
    struct Entry {
        RegionSpec region;
        bool folds;
    } entries[] = {
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
    for (const Entry &entry : entries) {
        RegionSpec shape = entry.region;
        shape.objectId = objectId++;
        process.region(shape);
    }
    // A second region of a folded object: "Other" counts the object once.
    process.region({.name = "mapped file", .objectId = 104, .clean = 4 * MiB});
    const VSVestage &vestage = run.gather();

    VSCategoryTotals plainTotals, foldedTotals;
    const VSCategoryTable plain =
        VSVestage::_summarizedCategoriesForCategories(vestage._categoriesForAllProcesses(), false, plainTotals);
    const VSCategoryTable folded =
        VSVestage::_summarizedCategoriesForCategories(vestage._categoriesForAllProcesses(), true, foldedTotals);
    std::set<std::string> kept;
    for (const Entry &entry : entries) {
        EXPECT_EQ(plain.count(entry.region.name), 1u) << entry.region.name;
        if (!entry.folds) {
            kept.insert(entry.region.name);
        }
    }
    EXPECT_EQ(plain.size(), std::size(entries));
    kept.insert("Other");
    std::set<std::string> foldedNames;
    for (const auto &entry : folded) {
        foldedNames.insert(entry.first);
    }
    EXPECT_EQ(foldedNames, kept);
    const VSMemoryCategory &other = folded.at("Other");
    EXPECT_EQ(other.totalDirtySize(), MiB);
    EXPECT_EQ(other.totalSwappedSize(), 512 * KiB);
    EXPECT_EQ(other.totalCleanSize(), 4 * MiB);
    EXPECT_EQ(other.totalRegions(), 5);
    // Folding moves figures around; the totals stay.
    EXPECT_TRUE(plainTotals == foldedTotals);
    EXPECT_EQ(plainTotals.regions, 9u);
    EXPECT_EQ(plainTotals.dirty, 4 * MiB + 1 + 16 * KiB);
}

TEST(Categories, SortOrder) {
    struct Entry {
        const char *name;
        std::uint64_t dirty, swapped, reclaimable, clean;
    } entries[] = {
        {"b-tie", 0, 0, 0, 16}, {"a-tie", 0, 0, 0, 16}, {"swapped", 0, 48, 0, 0}, {"dirty", 32, 0, 0, 0},
        {"reclaimable", 0, 0, 16, 0}, {"clean", 0, 0, 0, 32}, {"nothing", 0, 0, 0, 0}, {"mixed", 16, 16, 0, 64},
    };
    ReportRun run;
    PreparedProcess &process = run.process(1, "p");
    std::uint64_t objectId = 1;
    for (const Entry &e : entries) {
        process.region({.name = e.name, .objectId = objectId++, .dirty = e.dirty, .swapped = e.swapped,
                        .clean = e.clean, .reclaimable = e.reclaimable});
    }
    EXPECT_EQ(namesText(VSVestage::_sortedKeysForCategories(run.gather()._categoriesForAllProcesses())),
              "[swapped,mixed,dirty,reclaimable,clean,a-tie,b-tie,nothing]");
}

// Records every call; claims the optional operations only when asked to.
class RecordingFormatter : public VSOutputFormatter {
public:
    RecordingFormatter(std::string tag, bool optional, std::vector<std::string> &log)
        : _tag(std::move(tag)), _optional(optional), _log(&log) {}

    bool implementsOperation(VSOptionalFormatterOperation) const override { return _optional; }
    void printProcessHeader(const VSProcess &p) override { add("header " + std::to_string(p.pid())); }
    void endProcessHeader(const VSProcess &) override { add("end-header"); }
    void printProcessTotal(std::uint64_t total, const VSProcess &) override { add("total " + kb(total)); }
    void printProcessCategories(const VSCategoryTable &, const VSSortedCategoryKeys &keys,
                                const VSCategoryTotals &total) override {
        add("private " + namesText(keys) + " " + kb(total.dirty));
    }
    void printProcessAuxData(const VSAuxDataDictionary *aux) override { add(aux ? "aux" : "no aux"); }
    void printProcessesWithWarnings(const std::vector<const VSProcess *> &warned,
                                    const std::vector<const VSProcess *> &failed,
                                    const std::vector<std::string> &global) override {
        add("diagnostics " + std::to_string(warned.size()) + std::to_string(failed.size()) +
            std::to_string(global.size()));
    }
    void printSummaryCategories(const VSCategoryTable &, const VSSortedCategoryKeys &keys,
                                const VSCategoryTotals &total, bool hadErrors) override {
        add("summary " + namesText(keys) + " " + kb(total.dirty) + (hadErrors ? " errors" : ""));
    }
    void printGlobalAuxData(const VSAuxDataDictionary *aux) override { add(aux ? "global aux" : "no global aux"); }
    void end() override { add("end"); }
    void printSpanlistLikeOutputForProcess(const VSProcess &p,
                                           const std::vector<const VSMemoryRegion *> &regions) override {
        std::string starts;
        for (const VSMemoryRegion *region : regions) {
            starts += " " + std::to_string(region->start() / MiB);
        }
        add("listing " + std::to_string(p.pid()) + starts);
    }
    void printSharedCategories(const VSCategoryTable &, const VSSortedCategoryKeys &keys,
                               const VSProcessGroup &sharedWith, const VSProcess &,
                               const VSCategoryTotals &total) override {
        add("shared " + pidsText(sharedWith) + " " + namesText(keys) + " " + kb(total.dirty));
    }

private:
    static std::string kb(std::uint64_t bytes) { return std::to_string(bytes / KiB) + "K"; }
    void add(const std::string &entry) { _log->push_back(_tag + " " + entry); }
    std::string _tag;
    bool _optional;
    std::vector<std::string> *_log;
};

TEST(Report, OneWalkDrivesEveryFormatterInOrder) {
    ReportRun run;
    // 4 has memory of its own, shares "pair" with 3 and "triple" with 3 and 2.
    run.process(4, "four")
        .region({.name = "own", .objectId = 1, .start = 48 * MiB, .dirty = 64 * KiB})
        .region({.name = "pair", .objectId = 2, .start = 16 * MiB, .dirty = 32 * KiB})
        .region({.name = "triple", .objectId = 3, .start = 32 * MiB, .dirty = 16 * KiB})
        .aux(vs::makeAuxDictionary({{"KPRVT", vs::makeAuxData(1, true)}}));
    // 3's memory is all shared.
    run.process(3, "three")
        .region({.name = "pair", .objectId = 2, .dirty = 32 * KiB})
        .region({.name = "triple", .objectId = 3, .dirty = 16 * KiB});
    run.process(2, "two").region({.name = "triple", .objectId = 3, .dirty = 16 * KiB});
    // 1 maps nothing; 6 failed, yet its memory still counts in the summary.
    run.process(1, "one").warning("one: late");
    run.process(6, "six").region({.name = "lost", .objectId = 9, .dirty = 8 * KiB}).error("e");
    run.gather();

    std::vector<std::string> log;
    run.vestage->addOutputFormatter(std::make_unique<RecordingFormatter>("T", true, log));
    run.vestage->addOutputFormatter(std::make_unique<RecordingFormatter>("J", false, log));
    run.vestage->printOutputVerbose(true, false);

    const std::vector<std::string> expected = {
        // Listings first, in report order, regions by start; only where implemented.
        "T listing 4 16 32 48", "T listing 3 16 32", "T listing 2 16", "T listing 6 16", "T listing 1",
        // Each formatter gets the whole header before the next one does.
        "T header 4", "T total 112K", "T end-header", "J header 4", "J total 112K", "J end-header",
        "T private [own] 64K", "J private [own] 64K", "T shared {3,4} [pair] 32K", "T shared {2,3,4} [triple] 16K",
        "T aux", "J aux",
        "T header 3", "T total 48K", "T end-header", "J header 3", "J total 48K", "J end-header",
        "T shared {3,4} [pair] 32K", "T shared {2,3,4} [triple] 16K", "T no aux", "J no aux",
        "T header 2", "T total 16K", "T end-header", "J header 2", "J total 16K", "J end-header",
        "T shared {2,3,4} [triple] 16K", "T no aux", "J no aux",
        "T header 6", "T end-header", "J header 6", "J end-header",
        "T header 1", "T total 0K", "T end-header", "J header 1", "J total 0K", "J end-header",
        "T no aux", "J no aux",
        "T diagnostics 110", "J diagnostics 110",
        // The first formatter finishes before the next starts its summary.
        "T summary [own,pair,triple,lost] 120K errors", "T global aux", "T end",
        "J summary [own,pair,triple,lost] 120K errors", "J global aux", "J end",
    };
    EXPECT_EQ(log, expected);
}

TEST(Gathering, InterruptSkipsTargetsThatHaveNotStarted) {
    for (bool beforeGathering : {true, false}) {
        SCOPED_TRACE(beforeGathering ? "before gathering" : "while the highest pid gathers");
        ReportRun run;
        std::map<std::int32_t, PreparedProcess *> targets;
        for (std::int32_t pid : {10, 30, 20}) {
            targets[pid] = &run.process(pid, "p" + std::to_string(pid))
                                .region({.objectId = static_cast<std::uint64_t>(pid), .dirty = 16 * KiB});
        }
        // One worker: nothing else has started while the highest pid runs.
        TestVestage &vestage = run.build(1);
        if (beforeGathering) {
            vestage.cancel();
        } else {
            targets[30]->onGather([&vestage] { vestage.cancel(); });
        }
        vestage.gatherData();

        for (const auto &[pid, target] : targets) {
            const bool expectGathered = !beforeGathering && pid == 30;
            EXPECT_EQ(target->gathered(), expectGathered) << pid;
            EXPECT_EQ(vestage.pidToVestage().at(pid), expectGathered ? 16 * KiB : 0) << pid;
        }
        const std::string report = run.report();
        EXPECT_NE(report.find("\nErrors were encountered:\n"
                              "\tVestage exited early due to SIGINT and did not finish gathering all data\n"
                              "\nDue to errors, summary results may be invalid\n"),
                  std::string::npos)
            << report;
        EXPECT_NE(report.find(beforeGathering ? "Summary Vestage: 0 B (may be invalid due to errors)\n"
                                              : "Summary Vestage: 16 KB (may be invalid due to errors)\n"),
                  std::string::npos);
        EXPECT_LT(report.find("p30 [30]"), report.find("p20 [20]"));
        EXPECT_LT(report.find("p20 [20]"), report.find("p10 [10]"));
    }
}
