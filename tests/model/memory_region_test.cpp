#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "model/assert.h"
#include "model/memory_region.h"

namespace {

struct TagCase {
    std::uint32_t tag;
    std::optional<std::string> expected;
};

TEST(CategoryNameForTag, FixedTagsAndFallbacks) {
    const std::vector<TagCase> cases = {
        {0, std::nullopt},
        {1, "malloc metadata"},
        {2, "MALLOC_SMALL"},
        {3, "MALLOC_LARGE"},
        {4, "MALLOC_HUGE"},
        {5, "sbrk"},
        {6, "realloc"},
        {7, "MALLOC_TINY"},
        {8, "MALLOC_LARGE_REUSABLE"},
        {9, "MALLOC_LARGE_REUSED"},
        {10, "performance tool data"},
        {11, "MALLOC_NANO"},
        {18, "system/kernel diagnostics"},
        {30, "stack"},
        {31, "guard"},
        {32, "shared pmap"},
        {35, "unshared pmap"},
        {62, "SQLite page cache"},
        {63, "WebAssembly"},
        {64, "JS JIT generated code"},
        {65, "JS VM register file"},
        {66, "OpenGL Shading Language"},
        {80, "corpse info"},
        {90, "audio"},
        {91, "video bitstream"},
        // Slots the Linux layer relies on.
        {vs::kTagSharedMemory, "shared memory"},
        {vs::kTagVdso, "vdso"},
        {vs::kTagVvar, "vvar"},
        {vs::kTagVsyscall, "vsyscall"},
        {vs::kTagJitCode, "JIT code"},
        // Empty slots and numbers outside the table print the number.
        {12, "tag 12"},
        {19, "tag 19"},
        {85, "tag 85"},
        {99, "tag 99"},
        {239, "tag 239"},
        {256, "tag 256"},
        {0xFFFF, "tag 65535"},
        // The app-specific range is numbered from 1.
        {240, "app-specific tag 1"},
        {247, "app-specific tag 8"},
        {255, "app-specific tag 16"},
        // All bits set has its own name; the rest reads as signed.
        {0xFFFFFFFFu, "Non-volatile physical vestage"},
        {0xFFFFFFFEu, "tag -2"},
        {0x80000000u, "tag -2147483648"},
    };
    for (const TagCase &c : cases) {
        EXPECT_EQ(VSMemoryRegion::categoryNameForTag(c.tag), c.expected) << "tag " << c.tag;
    }
}

TEST(CategoryNameForTag, TableHoldsExactlyTheSeventyFourFilledSlots) {
    std::set<std::uint32_t> expected;
    auto addRange = [&](std::uint32_t first, std::uint32_t last) {
        for (std::uint32_t t = first; t <= last; ++t) {
            expected.insert(t);
        }
    };
    addRange(1, 11);
    addRange(18, 18);
    addRange(20, 21);
    addRange(30, 35);
    addRange(40, 46);
    addRange(50, 58);
    addRange(60, 84);
    addRange(86, 98);
    ASSERT_EQ(expected.size(), 74u);

    std::set<std::string> names;
    for (std::uint32_t tag = 0; tag < 256; ++tag) {
        const char *text = vs::userTagTableName(tag);
        const bool filled = text != nullptr && *text != '\0';
        EXPECT_EQ(filled, expected.count(tag) == 1) << "slot " << tag;
        if (filled) {
            // Two tags with one name would fold into one category.
            EXPECT_TRUE(names.insert(text).second) << "duplicate name " << text;
            EXPECT_LE(std::string(text).size(), 32u) << text;
        }
    }
    EXPECT_EQ(vs::userTagTableName(256), nullptr);
}

TEST(DynamicTagNames, StableDistinctAndNamedByCategoryLookup) {
    const std::uint32_t a = vs::registerDynamicTagName("region-test pool A");
    const std::uint32_t b = vs::registerDynamicTagName("region-test pool B");
    EXPECT_NE(a, b);
    EXPECT_EQ(vs::registerDynamicTagName("region-test pool A"), a);
    for (std::uint32_t tag : {a, b}) {
        EXPECT_GE(tag, 256u);
        EXPECT_NE(tag, 0xFFFFFFFFu);
    }
    EXPECT_EQ(VSMemoryRegion::categoryNameForTag(a), "region-test pool A");
    EXPECT_EQ(VSMemoryRegion::categoryNameForTag(b), "region-test pool B");
    // A dynamic number nobody registered still falls back to the number.
    const std::uint32_t unused = 0x7FFFFFF0u;
    EXPECT_EQ(VSMemoryRegion::categoryNameForTag(unused), "tag 2147483632");
}

TEST(DynamicTagNames, ConcurrentRegistrationAgreesOnEveryTag) {
    constexpr int kThreads = 8;
    constexpr int kNames = 200;
    std::vector<std::vector<std::uint32_t>> seen(kThreads, std::vector<std::uint32_t>(kNames));
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([t, &seen] {
            // Half the threads walk the names backwards to interleave first uses.
            for (int i = 0; i < kNames; ++i) {
                const int n = (t % 2 == 0) ? i : kNames - 1 - i;
                seen[t][n] = vs::registerDynamicTagName("concurrent " + std::to_string(n));
            }
        });
    }
    for (std::thread &thread : threads) {
        thread.join();
    }
    std::set<std::uint32_t> distinct(seen[0].begin(), seen[0].end());
    EXPECT_EQ(distinct.size(), static_cast<std::size_t>(kNames));
    for (int t = 1; t < kThreads; ++t) {
        EXPECT_EQ(seen[t], seen[0]) << "thread " << t;
    }
    for (int n = 0; n < kNames; ++n) {
        EXPECT_EQ(VSMemoryRegion::categoryNameForTag(seen[0][n]), "concurrent " + std::to_string(n));
    }
}

VSMemoryRegion regionAt(std::uint64_t start, std::uint64_t size) {
    VSMemoryRegion region;
    region.setStart(start);
    region.setSize(size);
    return region;
}

TEST(MemoryRegion, CompareOrdersByStartThenLargerSizeFirst) {
    struct Case {
        std::uint64_t startA, sizeA, startB, sizeB;
        std::int64_t expected;
    };
    const std::vector<Case> cases = {
        {0x1000, 0x2000, 0x1000, 0x1000, -1},
        {0x1000, 0x1000, 0x1000, 0x2000, 1},
        {0x1000, 0x1000, 0x1000, 0x1000, 0},
        {0x1000, 0x1, 0x2000, 0x9000, -1},
        {0x2000, 0x9000, 0x1000, 0x1, 1},
        // Unsigned: a high address is above a low one, not negative.
        {0xFFFFFFFFFFFFF000ull, 0x1000, 0x1000, 0x1000, 1},
        {0x1000, 0x1000, 0x8000000000000000ull, 0x1000, -1},
        {0x1000, 0x8000000000000000ull, 0x1000, 0x1000, -1},
    };
    for (const Case &c : cases) {
        EXPECT_EQ(regionAt(c.startA, c.sizeA).compare(regionAt(c.startB, c.sizeB)), c.expected)
            << std::hex << c.startA << "+" << c.sizeA << " vs " << c.startB << "+" << c.sizeB;
    }
}

TEST(MemoryRegion, SetEndKeepsStart) {
    struct Case {
        std::uint64_t start, size, newEnd, expectedSize;
    };
    const std::vector<Case> cases = {
        {0x1000, 0x5000, 0x3000, 0x2000},
        {0x1000, 0x5000, 0x1000, 0},
        {0x1000, 0, 0x9000, 0x8000},
        {0, 0, 0xFFFFFFFFFFFFFFFFull, 0xFFFFFFFFFFFFFFFFull},
    };
    for (const Case &c : cases) {
        VSMemoryRegion region = regionAt(c.start, c.size);
        region.setEnd(c.newEnd);
        EXPECT_EQ(region.start(), c.start);
        EXPECT_EQ(region.size(), c.expectedSize);
        EXPECT_EQ(region.end(), c.newEnd);
    }
}

TEST(MemoryRegionDeathTest, SetEndBelowStartAborts) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    VSMemoryRegion region = regionAt(0x2000, 0x1000);
    EXPECT_DEATH(region.setEnd(0x1FFF), "end >= self\\.start");
}

TEST(AssertDeathTest, ReportsConditionText) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    volatile int two = 2;
    EXPECT_DEATH(VS_ASSERT(two + 1 == 4), "two \\+ 1 == 4");
    EXPECT_DEATH(VS_ASSERT_MSG(two == 3, "custom invariant text"), "custom invariant text");
}

TEST(MemoryRegion, NewRegionIsEmptyAndCopiesKeepTheirOwnStrings) {
    VSMemoryRegion fresh;
    EXPECT_EQ(fresh.segment(), VSSegmentUnknown);
    EXPECT_EQ(fresh.memoryObject(), nullptr);
    EXPECT_FALSE(fresh.name() || fresh.detailedName());
    EXPECT_EQ(fresh.end() | fresh.offset() | fresh.dirtySize() | fresh.object_id() | fresh.user_tag(), 0u);

    VSMemoryRegion original = regionAt(0x4000, 0x8000);
    original.setName("mapped file");
    original.setDetailedName("/usr/lib/libfoo.so");
    original.setObject_id(42);
    VSMemoryRegion copy = original;
    original.setName("renamed");
    EXPECT_EQ(copy.name(), "mapped file");
    EXPECT_EQ(copy.detailedName(), "/usr/lib/libfoo.so");
    EXPECT_EQ(copy.end(), 0xC000u);
    EXPECT_EQ(copy.object_id(), 42u);
}

// A reader racing with a writer must see a whole string, never a mix.
TEST(MemoryRegion, NameReadsNeverSeeAHalfReplacedString) {
    const std::string first(100, 'a');
    const std::string second(300, 'b');
    VSMemoryRegion region;
    region.setName(first);
    std::atomic<bool> done{false};
    std::thread writer([&] {
        for (int i = 0; i < 20000; ++i) {
            region.setName(i % 2 ? first : second);
            region.setDetailedName(i % 2 ? second : first);
        }
        done = true;
    });
    int bad = 0;
    while (!done) {
        const std::optional<std::string> name = region.name();
        const std::optional<std::string> detail = region.detailedName();
        if (name != first && name != second) {
            ++bad;
        }
        if (detail && detail != first && detail != second) {
            ++bad;
        }
    }
    writer.join();
    EXPECT_EQ(bad, 0);
}

} // namespace
