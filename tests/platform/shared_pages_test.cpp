// The run-wide index of pages several targets map: which exact set of
// targets each page belongs to, the union of an object's pages over its
// mappings, and the compact form a target's page keys wait in.

#include "targets/platform/linux/shared_pages.h"

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

namespace {

// Keys mapped at consecutive pages from `page` on.
std::vector<vs::KeyRun> runsOf(const std::vector<uint64_t> &keys, uint64_t page = 0x1000) {
    std::vector<vs::KeyRun> runs;
    for (const uint64_t key : keys) {
        vs::appendKey(runs, key, page++);
    }
    return runs;
}

TEST(SharedPageIndex, EachPageBelongsToTheExactSetOfTargetsMappingIt) {
    struct Case {
        const char *what;
        std::vector<std::pair<int32_t, std::vector<uint64_t>>> adds; // pid, keys, in order
        uint64_t key;
        std::vector<int32_t> members; // empty: one target alone maps it
    };
    const uint64_t swapped = vs::kSwapKey | 0x4321;
    const std::vector<Case> cases = {
        {"one target alone", {{10, {5, 6}}}, 5, {}},
        {"a page seen twice by one target is still its own", {{10, {5, 5}}, {10, {5}}}, 5, {}},
        {"parent and child", {{10, {5, 6}}, {11, {5}}}, 5, {10, 11}},
        {"the child's copy is not the parent's page", {{10, {5, 6}}, {11, {5}}}, 6, {}},
        {"sets are sets: order of arrival does not matter", {{12, {7}}, {10, {7}}, {11, {7}}}, 7, {10, 11, 12}},
        {"a swapped page is known by its swap entry", {{10, {swapped}}, {11, {swapped}}}, swapped, {10, 11}},
        {"a frame number is no swap entry", {{10, {0x4321}}, {11, {swapped}}}, swapped, {}},
        {"a page nobody added", {{10, {1}}, {11, {1}}}, 2, {}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        vs::SharedPageIndex index;
        for (const auto &[pid, keys] : c.adds) {
            index.addPages(pid, runsOf(keys));
        }
        const std::optional<uint32_t> set = index.sharedSet(c.key);
        EXPECT_EQ(set.has_value(), !c.members.empty());
        if (set) {
            EXPECT_EQ(index.setMembers(*set), c.members);
        }
        index.freeze();
        EXPECT_EQ(index.sharedSet(c.key), set) << "the same answer once the index is frozen";
    }
}

TEST(SharedPageIndex, RunsAreCountedBySetAsTheIndexGrows) {
    // A parent's frames in runs of every length, across blocks and shards;
    // a child maps every other run (moved 1 GiB up), a grandchild part of
    // one (far below).
    vs::SharedPageIndex index;
    std::vector<vs::KeyRun> parent, child;
    constexpr uint64_t kMoved = 1ull << 18;
    uint64_t next = 1000, page = 0x50000, childPages = 0;
    for (uint64_t length = 1; length <= 700; ++length) {
        parent.push_back({next, length, page});
        if (length % 2 == 0) {
            child.push_back({next, length, page + kMoved});
            childPages += length;
        }
        next += length + 3;
        page += length + 1;
    }
    parent.push_back({vs::kSwapKey | 77, 5, page});
    child.push_back({vs::kSwapKey | 79, 5, page + 2 + kMoved}); // three of the parent's slots, two of its own
    index.addPages(1, parent);
    index.addPages(2, child);
    index.addPages(3, std::vector<vs::KeyRun>{{child[10].first + 2, 7, 0x100}});
    // Where each one's mapping of those pages begins.
    index.notePlace(child[0].first, child[0].page - kMoved);
    index.notePlace(child[0].first, child[0].page);
    index.notePlace(child[10].first + 2, 0x100);
    for (const bool frozen : {false, true}) {
        SCOPED_TRACE(frozen ? "frozen" : "still adding");
        if (frozen) {
            index.freeze();
        }
        std::vector<vs::SharedPageIndex::SetPages> sets;
        index.sharedPages(parent, sets);
        std::map<std::vector<int32_t>, std::pair<uint64_t, uint64_t>> byMembers;
        for (const auto &set : sets) {
            byMembers[index.setMembers(set.set)] = {set.presentPages, set.swappedPages};
        }
        using Pages = std::pair<uint64_t, uint64_t>;
        EXPECT_EQ(byMembers, (std::map<std::vector<int32_t>, Pages>{{{1, 2}, {childPages - 7, 3}},
                                                                    {{1, 2, 3}, {7, 0}}}));
        // Where the first page of each set lies, and the lowest place any
        // member maps it: the parent's, the grandchild's.
        for (const auto &set : sets) {
            const bool withGrandchild = index.setMembers(set.set).size() == 3;
            EXPECT_EQ(set.firstPage, withGrandchild ? child[10].page + 2 - kMoved : child[0].page - kMoved);
            EXPECT_EQ(set.lowestPage, withGrandchild ? 0x100 : child[0].page - kMoved);
        }
        index.sharedPages(child, sets);
        ASSERT_FALSE(sets.empty());
        EXPECT_EQ(sets[0].firstPage, child[0].page) << "the child's own place";
        EXPECT_EQ(sets[0].lowestPage, child[0].page - kMoved) << "the parent's, below it";
        // Page by page, wherever its run began, the same sets.
        std::map<std::vector<int32_t>, std::pair<uint64_t, uint64_t>> byPage;
        for (const vs::KeyRun &run : parent) {
            for (uint64_t key = run.first; key < run.first + run.length; ++key) {
                if (const auto set = index.sharedSet(key)) {
                    auto &pages = byPage[index.setMembers(*set)];
                    ((key & vs::kSwapKey) != 0 ? pages.second : pages.first) += 1;
                }
            }
        }
        EXPECT_EQ(byPage, byMembers);
        index.sharedPages(std::vector<vs::KeyRun>{{next + 10, 4096, 0}}, sets);
        EXPECT_TRUE(sets.empty()) << "pages nobody added";
    }
}

TEST(SharedPageIndex, AnObjectHoldsTheUnionOfItsMappingsPages) {
    auto bits = [](std::initializer_list<int> set) {
        std::vector<uint64_t> words(2, 0);
        for (int b : set) words[b / 64] |= 1ull << (b % 64);
        return words;
    };
    struct Case {
        const char *what;
        std::vector<vs::SharedPageIndex::Window> windows;
        uint64_t first, count;
        std::optional<std::pair<uint64_t, uint64_t>> pages; // resident, dirty
        std::optional<std::pair<uint64_t, uint64_t>> privatePages = {}; // the same, of private mappings
    };
    using W = vs::SharedPageIndex::Window;
    const std::vector<Case> cases = {
        {"one mapping alone: its own counts stand", {W{1, 2, 0, 100, bits({1, 2}), bits({1}), 0}}, 0, 100, {}},
        {"quarters written by different mappings",
         {W{1, 2, 0, 100, bits({1, 2}), bits({1, 2}), 0}, W{1, 2, 0, 100, bits({50, 51}), bits({50}), 0},
          W{1, 2, 0, 100, bits({}), bits({}), 0}},
         0, 100, std::pair<uint64_t, uint64_t>{4, 3}},
        {"mappings at other offsets meet at file pages",
         {W{1, 2, 10, 20, bits({0, 1}), bits({}), 0}, W{1, 2, 0, 40, bits({10, 30}), bits({30}), 0}},
         10, 21, std::pair<uint64_t, uint64_t>{3, 1}},
        {"a whole mapping holds every page of its range",
         {W{1, 2, 0, 8, {}, {}, 0}, W{1, 2, 0, 16, bits({12}), bits({}), 0}}, 0, 16,
         std::pair<uint64_t, uint64_t>{9, 0}},
        {"dirty state unknown: the most one mapping saw",
         {W{1, 2, 0, 100, bits({1, 2, 3}), {}, 2}, W{1, 2, 0, 100, bits({4}), {}, 1}}, 0, 100,
         std::pair<uint64_t, uint64_t>{4, 2}},
        {"another inode is another object", {W{1, 2, 0, 10, bits({1}), {}, 0}, W{1, 3, 0, 10, bits({2}), {}, 0}}, 0,
         10, {}},
        {"private mappings' page cache is kept apart from the shared mappings'",
         {W{1, 2, 0, 10, bits({1}), {}, 0}, W{1, 2, 0, 10, bits({2}), {}, 0, true},
          W{1, 2, 0, 10, bits({3}), {}, 0, true}},
         0, 10, {}, std::pair<uint64_t, uint64_t>{2, 0}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        vs::SharedPageIndex index;
        for (const W &w : c.windows) {
            index.addWindow(w);
        }
        for (const bool privateMappings : {false, true}) {
            const auto pages = index.objectPages(1, 2, privateMappings, c.first, c.count);
            const auto &want = privateMappings ? c.privatePages : c.pages;
            ASSERT_EQ(pages.has_value(), want.has_value()) << privateMappings;
            if (pages) {
                EXPECT_EQ(std::make_pair(pages->residentPages, pages->dirtyPages), *want);
            }
        }
    }
}

TEST(SharedPageIndex, KeyRunsComeBackAsTheyWent) {
    const std::vector<std::vector<uint64_t>> cases = {
        {},
        {7},
        {1, 2, 3, 4, 10, 11, 3, 2, 1},
        {vs::kSwapKey | 1, 5, vs::kSwapKey | 2, (1ull << 55) - 1},
        {UINT64_MAX, 0, UINT64_MAX},
    };
    for (const auto &keys : cases) {
        const std::vector<vs::KeyRun> runs = runsOf(keys);
        std::vector<uint8_t> bytes;
        vs::encodeKeyRuns(runs, bytes);
        std::vector<vs::KeyRun> back;
        vs::decodeKeyRuns(bytes, back);
        EXPECT_EQ(back, runs);
    }
    // Consecutive frames are what make it small.
    std::vector<uint64_t> run(65536);
    for (size_t i = 0; i < run.size(); ++i) run[i] = 0x123456 + i;
    EXPECT_EQ(runsOf(run), (std::vector<vs::KeyRun>{{0x123456, 65536, 0x1000}}));
    std::vector<vs::KeyRun> moved;
    vs::appendKey(moved, 5, 100);
    vs::appendKey(moved, 6, 101);
    vs::appendKey(moved, 7, 300);
    EXPECT_EQ(moved, (std::vector<vs::KeyRun>{{5, 2, 100}, {7, 1, 300}})) << "a page that does not follow ends a run";
    std::vector<uint8_t> bytes;
    vs::encodeKeyRuns(runsOf(run), bytes);
    EXPECT_LT(bytes.size(), 16u);
}

} // namespace
