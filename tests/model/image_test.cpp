#include <gtest/gtest.h>

#include <cstdint>
#include <vector>

#include "model/image.h"

namespace {

VSImage imageAt(std::uint64_t start, std::uint64_t end) {
    VSImage image;
    image.setStart(start);
    image.setSize(end - start);
    return image;
}

TEST(ImageEnumerator, WalksForwardOnly) {
    struct Query {
        std::uint64_t start, end;
        int expected; // index into the image list, or -1 for none
    };
    struct Case {
        const char *what;
        std::vector<std::pair<std::uint64_t, std::uint64_t>> images;
        std::vector<Query> queries; // asked in order on one enumerator
    };
    const std::vector<Case> cases = {
        {"an image is passed once the walk is beyond it; a lower range no longer finds it",
         {{0x1000, 0x2000}, {0x3000, 0x4000}},
         {{0x1800, 0x1900, 0}, {0x2000, 0x3000, -1}, {0x2800, 0x3800, 1}, {0x1800, 0x1900, -1}}},
        {"an image ending exactly at the start does not match and is passed", {{0x1000, 0x2000}},
         {{0x2000, 0x3000, -1}, {0x1000, 0x2000, -1}}},
        {"an image starting exactly at the end does not match and is kept", {{0x2000, 0x3000}},
         {{0x1000, 0x2000, -1}, {0x2000, 0x2100, 0}}},
        {"an image inside a larger range matches after passing an earlier one", {{0x1000, 0x2000}, {0x5000, 0x6000}},
         {{0x4000, 0x8000, 1}}},
        {"a returned image stays current for later overlapping ranges",
         {{0x1000, 0x3000}, {0x3000, 0x4000}},
         {{0x1000, 0x1800, 0}, {0x2800, 0x4000, 0}, {0x3000, 0x3800, 1}, {0x4000, 0x5000, -1}}},
        {"unsigned comparisons near the top of the address space",
         {{0x1000, 0x2000}, {0xFFFFFFFFFFFF0000ull, 0xFFFFFFFFFFFFF000ull}},
         {{0x8000000000000000ull, 0xFFFFFFFFFFFF1000ull, 1}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSImageList images;
        for (auto [start, end] : c.images) {
            images.push_back(imageAt(start, end));
        }
        VSImageEnumerator enumerator(images);
        for (const Query &q : c.queries) {
            const VSImage *expected = q.expected < 0 ? nullptr : &images[q.expected];
            EXPECT_EQ(enumerator.nextImageForStart(q.start, q.end), expected) << std::hex << q.start << "-" << q.end;
        }
    }
    // Images appended during the walk are seen.
    VSImageList images{imageAt(0x1000, 0x2000)};
    VSImageEnumerator enumerator(images);
    EXPECT_EQ(enumerator.nextImageForStart(0x3000, 0x4000), nullptr);
    images.push_back(imageAt(0x3000, 0x5000));
    EXPECT_EQ(enumerator.nextImageForStart(0x3000, 0x4000), &images[1]);
}

} // namespace
