#include <gtest/gtest.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "model/assert.h"
#include "model/memory_region.h"

namespace {

TEST(CategoryNameForTag, FixedTagsAndFallbacks) {
    const std::vector<std::pair<std::uint32_t, std::optional<std::string>>> cases = {
        {0, std::nullopt}, {1, "malloc metadata"}, {11, "MALLOC_NANO"}, {30, "stack"}, {31, "guard"},
        {98, "sanitizer shadow"}, {vs::kTagSharedMemory, "shared memory"}, {vs::kTagJitCode, "JIT code"},
        // Empty slots and numbers outside the table print the number.
        {12, "tag 12"}, {85, "tag 85"}, {99, "tag 99"}, {239, "tag 239"}, {256, "tag 256"},
        // The app-specific range is numbered from 1.
        {240, "app-specific tag 1"}, {255, "app-specific tag 16"},
        // All bits set has its own name; other unnamed numbers read as signed.
        {0xFFFFFFFFu, "Non-volatile physical vestage"}, {0xFFFFFFFEu, "tag -2"}, {0x80000000u, "tag -2147483648"},
        {0x7FFFFFF0u, "tag 2147483632"},
    };
    for (const auto &[tag, expected] : cases) {
        EXPECT_EQ(VSMemoryRegion::categoryNameForTag(tag), expected) << "tag " << tag;
    }
}

TEST(MemoryRegion, CompareOrdersByStartThenLargerSizeFirst) {
    struct Case {
        std::uint64_t startA, sizeA, startB, sizeB;
        std::int64_t expected;
    };
    const std::vector<Case> cases = {
        {0x1000, 0x2000, 0x1000, 0x1000, -1},
        {0x1000, 0x1000, 0x1000, 0x1000, 0},
        {0x2000, 0x9000, 0x1000, 0x1, 1},
        // Unsigned: a high address is above a low one, not negative.
        {0xFFFFFFFFFFFFF000ull, 0x1000, 0x1000, 0x1000, 1},
        {0x1000, 0x8000000000000000ull, 0x1000, 0x1000, -1},
    };
    auto region = [](std::uint64_t start, std::uint64_t size) {
        VSMemoryRegion r;
        r.setStart(start);
        r.setSize(size);
        return r;
    };
    for (const Case &c : cases) {
        EXPECT_EQ(region(c.startA, c.sizeA).compare(region(c.startB, c.sizeB)), c.expected)
            << std::hex << c.startA << "+" << c.sizeA << " vs " << c.startB << "+" << c.sizeB;
    }
}

TEST(AssertDeathTest, ReportsConditionText) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    volatile int two = 2;
    EXPECT_DEATH(VS_ASSERT(two + 1 == 4), "two \\+ 1 == 4");
}

} // namespace
