#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <functional>
#include <cstdint>
#include <memory>
#include <tuple>
#include <vector>

#include "model/memory_object.h"
#include "model/memory_region.h"

namespace {

constexpr std::uint64_t P = 0x4000;

using Sizes = std::array<std::uint64_t, 5>; // dirty, clean, swapped, reclaimable, wired
using Node = std::tuple<std::uint64_t, std::uint64_t, Sizes>; // offset, size, sizes

Sizes dirty(std::uint64_t bytes) { return {bytes, 0, 0, 0, 0}; }

struct RegionShape {
    std::uint64_t offset, size;
    Sizes sizes;
    std::uint64_t objectId = 1;
};

std::unique_ptr<VSMemoryRegion> makeRegion(const RegionShape &shape) {
    auto region = std::make_unique<VSMemoryRegion>();
    region->setOffset(shape.offset);
    region->setSize(shape.size);
    region->setDirtySize(shape.sizes[0]);
    region->setCleanNonSpecSize(shape.sizes[1]);
    region->setSwappedSize(shape.sizes[2]);
    region->setReclaimableSize(shape.sizes[3]);
    region->setWiredSize(shape.sizes[4]);
    region->setObject_id(shape.objectId);
    return region;
}

TEST(MemoryObject, RangeListMerges) {
    struct Case {
        const char *what;
        std::uint64_t pageSize;
        std::vector<RegionShape> regions; // added in this order
        std::vector<Node> nodes;         // the range list afterwards
    };
    const std::vector<Case> cases = {
        {"same range twice counts once", P, {{0, 0x8000, dirty(0x8000)}, {0, 0x8000, dirty(0x8000)}},
         {{0, 0x8000, dirty(0x8000)}}},
        {"half overlap", P, {{0, 0x8000, dirty(0x8000)}, {0x4000, 0x8000, dirty(0x4000)}},
         {{0, 0xC000, dirty(0x8000)}}},
        {"touching at a page boundary: one node, sizes summed", P,
         {{0, 0x4000, dirty(0x4000)}, {0x4000, 0x4000, dirty(0x4000)}}, {{0, 0x8000, dirty(0x8000)}}},
        {"one page apart: two nodes", P, {{0, 0x4000, dirty(0x4000)}, {0x8000, 0x4000, dirty(0x2000)}},
         {{0, 0x4000, dirty(0x4000)}, {0x8000, 0x4000, dirty(0x2000)}}},
        {"two sub-page regions in one page overlap by the whole page", P,
         {{0x100, 0x100, dirty(0x100)}, {0x3000, 0x100, dirty(0x80)}}, {{0x100, 0x3000, dirty(0x100)}}},
        {"sub-page regions in neighbouring pages touch", P,
         {{0x3F00, 0x100, dirty(0x100)}, {0x4000, 0x100, dirty(0x100)}}, {{0x3F00, 0x200, dirty(0x200)}}},
        {"max rule: sum less overlap would fall below the existing size", P,
         {{0, 0x4000, dirty(0x2000)}, {0, 0x10000, dirty(0x1000)}}, {{0, 0x10000, dirty(0x2000)}}},
        {"max rule: the arriving region keeps at least its own size", P,
         {{0x4000, 0x4000, dirty(0x4000)}, {0, 0x10000, dirty(0xC000)}}, {{0, 0x10000, dirty(0xC000)}}},
        {"bridging region merges both neighbours", P,
         {{0, 0x4000, dirty(0x4000)}, {0x8000, 0x4000, dirty(0x4000)}, {0x4000, 0x4000, dirty(0x4000)}},
         {{0, 0xC000, dirty(0xC000)}}},
        // vs first: overlap 0x4000 -> max(0x14000-0x4000, 0xC000) = 0x10000;
        // vs second: overlap 0x4000 -> max(0x14000-0x4000, 0x10000) = 0x10000.
        {"bridging with overlap on both sides, merged in list order", P,
         {{0, 0x8000, dirty(0x8000)}, {0xC000, 0x8000, dirty(0x4000)}, {0x4000, 0xC000, dirty(0xC000)}},
         {{0, 0x14000, dirty(0x10000)}}},
        {"only the overlapped middle node merges; order stays ascending", P,
         {{0x20000, 0x4000, dirty(3)}, {0, 0x4000, dirty(1)}, {0x10000, 0x4000, dirty(2)},
          {0x12000, 0x100, dirty(0x100)}},
         {{0, 0x4000, dirty(1)}, {0x10000, 0x4000, dirty(0x100)}, {0x20000, 0x4000, dirty(3)}}},
        // overlap 0x4000: dirty max(0x8000,0x8000); clean max(0,0x4000);
        // swapped max(0,0x4000); reclaimable max(0x6000,0x8000); wired max(0xC000,0x8000).
        {"all five sizes merge independently", P,
         {{0, 0x8000, {0x4000, 0x4000, 0, 0x8000, 0x8000}}, {0x4000, 0x8000, {0x8000, 0, 0x4000, 0x2000, 0x8000}}},
         {{0, 0xC000, {0x8000, 0x4000, 0x4000, 0x8000, 0xC000}}}},
        {"overlap counts the existing node's whole pages", P,
         {{0x3000, 0x2000, dirty(0x8000)}, {0x4000, 0x4000, dirty(0x4000)}}, {{0x3000, 0x5000, dirty(0x8000)}}},
        {"overlap counts the arriving region's whole pages", P,
         {{0x4000, 0x4000, dirty(0x4000)}, {0x3000, 0x2000, dirty(0x8000)}}, {{0x3000, 0x5000, dirty(0x8000)}}},
        {"object id 0 adds nothing", P, {{0, 0x4000, dirty(0x4000)}, {0, 0x8000, dirty(0x8000), 0}},
         {{0, 0x4000, dirty(0x4000)}}},
        {"smaller page size separates what a larger one joins", 0x1000,
         {{0x100, 0x100, dirty(0x100)}, {0x3000, 0x100, dirty(0x80)}},
         {{0x100, 0x100, dirty(0x100)}, {0x3000, 0x100, dirty(0x80)}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        std::vector<std::unique_ptr<VSMemoryRegion>> owned;
        VSMemoryObject object;
        for (const RegionShape &shape : c.regions) {
            owned.push_back(makeRegion(shape));
            object.addRegion(owned.back().get(), c.pageSize);
        }
        object.calculateSizes();
        std::vector<Node> nodes;
        Sizes totals{}; // of the nodes
        for (const VSRangeListNode *n = object.rangeListHead(); n; n = n->next.get()) {
            const Sizes sizes{n->dirtySize, n->cleanSize, n->swappedSize, n->reclaimableSize, n->wiredSize};
            nodes.emplace_back(n->offset, n->size, sizes);
            std::transform(totals.begin(), totals.end(), sizes.begin(), totals.begin(), std::plus<>());
        }
        EXPECT_EQ(nodes, c.nodes);
        EXPECT_EQ(totals, (Sizes{object.totalDirtySize(), object.totalCleanSize(), object.totalSwappedSize(),
                                 object.totalReclaimableSize(), object.totalWiredSize()}));
        EXPECT_EQ(object.memoryRegions().size(), c.regions.size());
    }
}

// Objects backing a large file mapped in many separate pieces hold long
// lists; releasing them must not recurse once per node.
TEST(MemoryObject, ReleasesAVeryLongRangeList) {
    constexpr std::uint64_t kNodes = 1'000'000;
    VSMemoryRegion region;
    region.setObject_id(7);
    region.setSize(0x1000);
    region.setDirtySize(0x1000);
    VSMemoryObject object;
    // The first region added is read when the object is sized, so it keeps
    // its figures; the others are copied into the list as they come.
    VSMemoryRegion last = region;
    last.setOffset(kNodes * 2 * P);
    object.addRegion(&last, P);
    // Descending offsets: every insertion lands in front, so this stays fast.
    for (std::uint64_t i = kNodes - 1; i-- > 0;) {
        region.setOffset(i * 2 * P);
        object.addRegion(&region, P);
    }
    object.calculateSizes();
    EXPECT_EQ(object.totalDirtySize(), kNodes * 0x1000);
}

} // namespace
