// The run-wide index of pages several targets map: which exact set of
// targets each page belongs to, the union of an object's pages over its
// mappings, and the compact form a target's page keys wait in.

#include "targets/platform/linux/shared_pages.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

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
            index.addPages(pid, keys);
        }
        const std::optional<uint32_t> set = index.sharedSet(c.key);
        EXPECT_EQ(set.has_value(), !c.members.empty());
        if (set) {
            EXPECT_EQ(index.setMembers(*set), c.members);
        }
        std::vector<uint32_t> sets;
        index.sharedSets(std::vector<uint64_t>{c.key}, sets);
        EXPECT_EQ(sets.at(0), set.value_or(vs::SharedPageIndex::kNoSet)) << "one lookup or many, the same answer";
    }
}

TEST(SharedPageIndex, ManyPagesKeepTheirSetsAsTheIndexGrows) {
    vs::SharedPageIndex index;
    std::vector<uint64_t> parent, child;
    for (uint64_t frame = 1; frame <= 100000; ++frame) {
        parent.push_back(frame * 3);
        if (frame % 2 == 0) {
            child.push_back(frame * 3);
        }
    }
    index.addPages(1, parent);
    index.addPages(2, child);
    std::vector<uint32_t> sets;
    index.sharedSets(parent, sets);
    for (size_t i = 0; i < parent.size(); ++i) {
        ASSERT_EQ(sets[i] != vs::SharedPageIndex::kNoSet, i % 2 == 1) << parent[i];
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
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        vs::SharedPageIndex index;
        for (const W &w : c.windows) {
            index.addWindow(w);
        }
        const auto pages = index.objectPages(1, 2, c.first, c.count);
        ASSERT_EQ(pages.has_value(), c.pages.has_value());
        if (pages) {
            EXPECT_EQ(std::make_pair(pages->residentPages, pages->dirtyPages), *c.pages);
        }
    }
}

TEST(SharedPageIndex, KeyRunsGiveBackEveryKeyInOrder) {
    const std::vector<std::vector<uint64_t>> cases = {
        {},
        {7},
        {1, 2, 3, 4, 10, 11, 3, 2, 1},
        {vs::kSwapKey | 1, 5, vs::kSwapKey | 2, (1ull << 55) - 1},
        {UINT64_MAX, 0, UINT64_MAX},
    };
    for (const auto &keys : cases) {
        std::vector<uint8_t> bytes;
        vs::encodeKeyRuns(keys, bytes);
        std::vector<uint64_t> back;
        vs::decodeKeyRuns(bytes, back);
        EXPECT_EQ(back, keys);
    }
    // Consecutive frames are what make it small.
    std::vector<uint64_t> run(65536);
    for (size_t i = 0; i < run.size(); ++i) run[i] = 0x123456 + i;
    std::vector<uint8_t> bytes;
    vs::encodeKeyRuns(run, bytes);
    EXPECT_LT(bytes.size(), 16u);
}

} // namespace
