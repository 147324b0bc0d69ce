#include <gtest/gtest.h>

#include <cstddef>
#include <vector>

#include "model/pointer_set.h"

namespace {

// Sets of every size the representation changes at: empty, one inline
// member, a few searched linearly, just past the linear limit, and large
// enough for the index to grow several times; each with and without room
// reserved first (before any member, and after the first one), and with the
// first half added as known new members, whose index catches up later.
TEST(PointerSet, KeepsFirstAdditionOrderAndFindsEveryMember) {
    struct Case {
        std::size_t members;
        std::size_t reserveBefore; // 0: none
        bool reserveAfterFirst;
        bool appendFirstHalf = false;
    };
    const Case cases[] = {{0, 0, false},   {1, 0, false},  {1, 100, false}, {2, 0, false},  {16, 0, false},
                          {17, 0, false},  {17, 40, false}, {18, 0, true},   {300, 0, false}, {300, 1000, false},
                          {1000, 0, true}, {5000, 64, false}, {17, 0, false, true}, {40, 0, false, true},
                          {300, 1000, false, true},        {5000, 64, false, true}};
    for (const Case &c : cases) {
        SCOPED_TRACE(testing::Message() << c.members << " members, reserve " << c.reserveBefore
                                        << (c.reserveAfterFirst ? " after first" : "")
                                        << (c.appendFirstHalf ? ", first half appended" : ""));
        std::vector<int> storage(c.members + 1);
        // An order unlike the addresses', so that the index is what finds them.
        std::vector<int *> order;
        for (std::size_t i = 0; i < c.members; ++i) {
            order.push_back(&storage[(i * 7919) % c.members]);
        }
        vs::PointerSet<int> set;
        if (c.reserveBefore != 0) {
            set.reserve(c.reserveBefore);
        }
        for (std::size_t i = 0; i < order.size(); ++i) {
            if (c.appendFirstHalf && i < order.size() / 2) {
                set.appendNew(order[i]);
                EXPECT_EQ(set.size(), i + 1);
                continue;
            }
            const auto [index, added] = set.insertIndex(order[i]);
            EXPECT_TRUE(added);
            EXPECT_EQ(index, i);
            if (i == 0 && c.reserveAfterFirst) {
                set.reserve(c.members);
            }
        }
        // Adding every member again changes nothing and tells where each is.
        for (std::size_t i = 0; i < order.size(); ++i) {
            const auto [index, added] = set.insertIndex(order[order.size() - 1 - i]);
            EXPECT_FALSE(added);
            EXPECT_EQ(index, order.size() - 1 - i);
        }
        ASSERT_EQ(set.size(), order.size());
        EXPECT_EQ(set.empty(), order.empty());
        EXPECT_EQ(std::vector<int *>(set.begin(), set.end()), order);
        EXPECT_EQ(std::vector<int *>(set.items().begin(), set.items().end()), order);
        EXPECT_FALSE(set.contains(&storage[c.members])); // never added
        EXPECT_EQ(set.indexOf(&storage[c.members]), vs::PointerSet<int>::kNotFound);

        // A copy is a set of its own.
        vs::PointerSet<int> copy = set;
        EXPECT_TRUE(copy.insert(&storage[c.members]));
        EXPECT_EQ(copy.size(), order.size() + 1);
        EXPECT_EQ(set.size(), order.size());
        EXPECT_FALSE(set.contains(&storage[c.members]));
        for (int *p : order) {
            EXPECT_TRUE(copy.contains(p));
        }
        // A moved set takes the members and their order along.
        vs::PointerSet<int> moved = std::move(copy);
        ASSERT_EQ(moved.size(), order.size() + 1);
        EXPECT_EQ(std::vector<int *>(moved.begin(), moved.end() - 1), order);
        EXPECT_EQ(moved.indexOf(&storage[c.members]), order.size());

        // A union adds only what is new, in the other set's order.
        vs::PointerSet<int> merged;
        merged.insert(&storage[c.members]);
        merged.unionWith(set);
        merged.unionWith(moved);
        ASSERT_EQ(merged.size(), order.size() + 1);
        EXPECT_EQ(*merged.begin(), &storage[c.members]);
        EXPECT_EQ(std::vector<int *>(merged.begin() + 1, merged.end()), order);
    }
}

} // namespace
