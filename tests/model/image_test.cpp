#include <gtest/gtest.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "model/image.h"

namespace {

VSImage imageAt(std::uint64_t start, std::uint64_t end) {
    VSImage image;
    image.setStart(start);
    image.setSize(end - start);
    return image;
}

struct Query {
    std::uint64_t start, end;
    int expected; // index into the image list, or -1 for none
};

struct WalkCase {
    const char *what;
    std::vector<std::pair<std::uint64_t, std::uint64_t>> images;
    std::vector<Query> queries; // asked in order on one enumerator
};

TEST(ImageEnumerator, WalksForwardOnly) {
    const std::vector<WalkCase> cases = {
        {"passes an image only once the walk is beyond it",
         {{0x1000, 0x2000}, {0x3000, 0x4000}},
         {{0x1800, 0x1900, 0}, {0x2000, 0x3000, -1}, {0x2800, 0x3800, 1},
          // The first image was passed: a lower range no longer finds it.
          {0x1800, 0x1900, -1}}},
        {"an image ending exactly at the start does not match and is passed",
         {{0x1000, 0x2000}},
         {{0x2000, 0x3000, -1}, {0x1000, 0x2000, -1}}},
        {"an image starting exactly at the end does not match and is kept",
         {{0x2000, 0x3000}},
         {{0x1000, 0x2000, -1}, {0x2000, 0x2100, 0}}},
        {"an image inside a larger range matches after passing an earlier one",
         {{0x1000, 0x2000}, {0x5000, 0x6000}},
         {{0x4000, 0x8000, 1}}},
        {"an image reaching past the range's end matches",
         {{0x2000, 0x5000}},
         {{0x1000, 0x3000, 0}}},
        {"a returned image stays current for later overlapping ranges",
         {{0x1000, 0x3000}, {0x3000, 0x4000}},
         {{0x1000, 0x1800, 0}, {0x1800, 0x2000, 0}, {0x2800, 0x4000, 0}, {0x3000, 0x3800, 1},
          {0x4000, 0x5000, -1}, {0x9000, 0xA000, -1}}},
        {"an empty list yields nothing", {}, {{0, 0x1000, -1}, {0x1000, 0x2000, -1}}},
        {"unsigned comparisons near the top of the address space",
         {{0x1000, 0x2000}, {0xFFFFFFFFFFFF0000ull, 0xFFFFFFFFFFFFF000ull}},
         {{0x8000000000000000ull, 0xFFFFFFFFFFFF1000ull, 1}}},
    };
    for (const WalkCase &c : cases) {
        SCOPED_TRACE(c.what);
        VSImageList images;
        for (auto [start, end] : c.images) {
            images.push_back(imageAt(start, end));
        }
        VSImageEnumerator enumerator(images);
        for (const Query &q : c.queries) {
            const VSImage *found = enumerator.nextImageForStart(q.start, q.end);
            const VSImage *expected = q.expected < 0 ? nullptr : &images[q.expected];
            EXPECT_EQ(found, expected) << std::hex << "[0x" << q.start << ", 0x" << q.end << ")";
        }
    }
}

TEST(ImageEnumerator, SeesImagesAppendedDuringTheWalk) {
    VSImageList images;
    images.push_back(imageAt(0x1000, 0x2000));
    VSImageEnumerator enumerator(images);
    EXPECT_EQ(enumerator.nextImageForStart(0x3000, 0x4000), nullptr);
    images.push_back(imageAt(0x3000, 0x5000));
    const VSImage *found = enumerator.nextImageForStart(0x3000, 0x4000);
    ASSERT_NE(found, nullptr);
    EXPECT_EQ(found->start(), 0x3000u);
}

TEST(Image, SetNameClassifiesTheSegment) {
    struct Case {
        std::vector<std::optional<std::string>> names; // set in order
        VSSegmentKind expected;
    };
    const std::vector<Case> cases = {
        {{}, VSSegmentUnknown},
        {{"__DATA"}, VSSegmentData},
        {{"__DATA_CONST"}, VSSegmentData},
        {{"__DATA_DIRTY"}, VSSegmentData},
        {{"__TEXT"}, VSSegmentText},
        {{"__LINKEDIT"}, VSSegmentLinkedit},
        {{"__TEXT_EXEC"}, VSSegmentUnknown},
        {{"__LINKEDIT_X"}, VSSegmentUnknown},
        {{"__text"}, VSSegmentUnknown},
        {{"__data"}, VSSegmentUnknown},
        {{"__DAT"}, VSSegmentUnknown},
        {{""}, VSSegmentUnknown},
        {{std::nullopt}, VSSegmentUnknown},
        // Unrecognised names keep the previous kind.
        {{"__TEXT", "__OBJECTS"}, VSSegmentText},
        {{"__TEXT", std::nullopt}, VSSegmentText},
        {{"__TEXT", "__DATA"}, VSSegmentData},
        {{"__DATA", "__LINKEDIT"}, VSSegmentLinkedit},
        {{"MALLOC_TINY", "stack"}, VSSegmentUnknown},
    };
    for (const Case &c : cases) {
        VSImage image;
        for (const auto &name : c.names) {
            image.setName(name);
        }
        EXPECT_EQ(image.segment(), c.expected) << (c.names.empty() ? "(none)" : c.names.back().value_or("(null)"));
        if (!c.names.empty()) {
            EXPECT_EQ(image.name(), c.names.back());
        }
    }
}

} // namespace
