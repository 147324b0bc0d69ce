#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "model/memory_object.h"
#include "model/memory_region.h"

namespace {

constexpr std::uint64_t P = 0x4000;

struct Sizes {
    std::uint64_t dirty = 0;
    std::uint64_t clean = 0;
    std::uint64_t swapped = 0;
    std::uint64_t reclaimable = 0;
    std::uint64_t wired = 0;
    bool operator==(const Sizes &) const = default;
};

struct RegionSpec {
    std::uint64_t offset;
    std::uint64_t size;
    Sizes sizes;
    std::uint64_t objectId = 1;
};

struct NodeSpec {
    std::uint64_t offset;
    std::uint64_t size;
    Sizes sizes;
    bool operator==(const NodeSpec &) const = default;
};

std::ostream &operator<<(std::ostream &out, const NodeSpec &n) {
    return out << std::hex << "{0x" << n.offset << "+0x" << n.size << " d0x" << n.sizes.dirty << " c0x"
               << n.sizes.clean << " s0x" << n.sizes.swapped << " r0x" << n.sizes.reclaimable << " w0x"
               << n.sizes.wired << "}";
}

std::unique_ptr<VSMemoryRegion> makeRegion(const RegionSpec &shape) {
    auto region = std::make_unique<VSMemoryRegion>();
    region->setOffset(shape.offset);
    region->setSize(shape.size);
    region->setStart(0x100000000ull + shape.offset);
    region->setDirtySize(shape.sizes.dirty);
    region->setCleanNonSpecSize(shape.sizes.clean);
    region->setSwappedSize(shape.sizes.swapped);
    region->setReclaimableSize(shape.sizes.reclaimable);
    region->setWiredSize(shape.sizes.wired);
    region->setObject_id(shape.objectId);
    return region;
}

std::vector<NodeSpec> nodesOf(const VSMemoryObject &object) {
    std::vector<NodeSpec> nodes;
    for (const VSRangeListNode *n = object.rangeListHead(); n; n = n->next.get()) {
        nodes.push_back({n->offset, n->size,
                         {n->dirtySize, n->cleanSize, n->swappedSize, n->reclaimableSize, n->wiredSize}});
    }
    return nodes;
}

Sizes totalsOf(const VSMemoryObject &object) {
    return {object.totalDirtySize(), object.totalCleanSize(), object.totalSwappedSize(),
            object.totalReclaimableSize(), object.totalWiredSize()};
}

Sizes dirty(std::uint64_t d) { return {d, 0, 0, 0, 0}; }

struct MergeCase {
    const char *what;
    std::uint64_t pageSize;
    std::vector<RegionSpec> regions; // added in this order
    std::vector<NodeSpec> nodes;     // the range list afterwards
    Sizes totals;
};

TEST(MemoryObject, RangeListMerges) {
    const std::vector<MergeCase> cases = {
        {"one region", P, {{0, 0x8000, dirty(0x8000)}}, {{0, 0x8000, dirty(0x8000)}}, dirty(0x8000)},
        {"same range twice counts once",
         P,
         {{0, 0x8000, dirty(0x8000)}, {0, 0x8000, dirty(0x8000)}},
         {{0, 0x8000, dirty(0x8000)}},
         dirty(0x8000)},
        {"half overlap",
         P,
         {{0, 0x8000, dirty(0x8000)}, {0x4000, 0x8000, dirty(0x4000)}},
         {{0, 0xC000, dirty(0x8000)}},
         dirty(0x8000)},
        {"touching at a page boundary: one node, sizes summed",
         P,
         {{0, 0x4000, dirty(0x4000)}, {0x4000, 0x4000, dirty(0x4000)}},
         {{0, 0x8000, dirty(0x8000)}},
         dirty(0x8000)},
        {"one page apart: two nodes",
         P,
         {{0, 0x4000, dirty(0x4000)}, {0x8000, 0x4000, dirty(0x2000)}},
         {{0, 0x4000, dirty(0x4000)}, {0x8000, 0x4000, dirty(0x2000)}},
         dirty(0x6000)},
        {"sub-page region keeps its exact range", P, {{0x100, 0x100, dirty(0x100)}},
         {{0x100, 0x100, dirty(0x100)}}, dirty(0x100)},
        {"two sub-page regions in one page overlap by the whole page",
         P,
         {{0x100, 0x100, dirty(0x100)}, {0x3000, 0x100, dirty(0x80)}},
         {{0x100, 0x3000, dirty(0x100)}},
         dirty(0x100)},
        {"sub-page regions in neighbouring pages touch",
         P,
         {{0x3F00, 0x100, dirty(0x100)}, {0x4000, 0x100, dirty(0x100)}},
         {{0x3F00, 0x200, dirty(0x200)}},
         dirty(0x200)},
        {"max rule: sum less overlap would fall below the larger size",
         P,
         {{0, 0x4000, dirty(0x2000)}, {0, 0x10000, dirty(0x1000)}},
         {{0, 0x10000, dirty(0x2000)}},
         dirty(0x2000)},
        {"larger region keeps at least its own sizes",
         P,
         {{0x4000, 0x4000, dirty(0x4000)}, {0, 0x10000, dirty(0xC000)}},
         {{0, 0x10000, dirty(0xC000)}},
         dirty(0xC000)},
        {"bridging region merges both neighbours",
         P,
         {{0, 0x4000, dirty(0x4000)}, {0x8000, 0x4000, dirty(0x4000)}, {0x4000, 0x4000, dirty(0x4000)}},
         {{0, 0xC000, dirty(0xC000)}},
         dirty(0xC000)},
        {"bridging with overlap on both sides, merged in list order",
         P,
         {{0, 0x8000, dirty(0x8000)}, {0xC000, 0x8000, dirty(0x4000)}, {0x4000, 0xC000, dirty(0xC000)}},
         // vs first: overlap 0x4000 -> max(0x14000-0x4000, 0xC000) = 0x10000;
         // vs second: overlap 0x4000 -> max(0x14000-0x4000, 0x10000) = 0x10000.
         {{0, 0x14000, dirty(0x10000)}},
         dirty(0x10000)},
        {"insertions keep ascending order",
         P,
         {{0x20000, 0x4000, dirty(3)}, {0, 0x4000, dirty(1)}, {0x10000, 0x4000, dirty(2)}},
         {{0, 0x4000, dirty(1)}, {0x10000, 0x4000, dirty(2)}, {0x20000, 0x4000, dirty(3)}},
         dirty(6)},
        {"only the overlapped middle node merges",
         P,
         {{0, 0x4000, dirty(1)}, {0x10000, 0x4000, dirty(2)}, {0x20000, 0x4000, dirty(3)},
          {0x12000, 0x100, dirty(0x100)}},
         {{0, 0x4000, dirty(1)}, {0x10000, 0x4000, dirty(0x100)}, {0x20000, 0x4000, dirty(3)}},
         dirty(0x104)},
        {"region starting inside and ending past a node",
         P,
         {{0x8000, 0x8000, dirty(0x8000)}, {0xC000, 0x8000, dirty(0x8000)}},
         {{0x8000, 0xC000, dirty(0xC000)}},
         dirty(0xC000)},
        {"all five sizes merge independently",
         P,
         {{0, 0x8000, {0x4000, 0x4000, 0, 0x8000, 0x8000}}, {0x4000, 0x8000, {0x8000, 0, 0x4000, 0x2000, 0x8000}}},
         // overlap 0x4000: dirty max(0x8000,0x8000); clean max(0,0x4000);
         // swapped max(0,0x4000); reclaimable max(0x6000,0x8000); wired max(0xC000,0x8000).
         {{0, 0xC000, {0x8000, 0x4000, 0x4000, 0x8000, 0xC000}}},
         {0x8000, 0x4000, 0x4000, 0x8000, 0xC000}},
        {"overlap counts the existing node's whole pages",
         P,
         {{0x3000, 0x2000, dirty(0x8000)}, {0x4000, 0x4000, dirty(0x4000)}},
         {{0x3000, 0x5000, dirty(0x8000)}},
         dirty(0x8000)},
        {"overlap counts the arriving region's whole pages",
         P,
         {{0x4000, 0x4000, dirty(0x4000)}, {0x3000, 0x2000, dirty(0x8000)}},
         {{0x3000, 0x5000, dirty(0x8000)}},
         dirty(0x8000)},
        {"object id 0 adds nothing",
         P,
         {{0, 0x8000, dirty(0x8000), 0}},
         {},
         {}},
        {"object id 0 beside a real range",
         P,
         {{0, 0x4000, dirty(0x4000)}, {0, 0x8000, dirty(0x8000), 0}},
         {{0, 0x4000, dirty(0x4000)}},
         dirty(0x4000)},
        {"smaller page size separates what a larger one joins",
         0x1000,
         {{0x100, 0x100, dirty(0x100)}, {0x3000, 0x100, dirty(0x80)}},
         {{0x100, 0x100, dirty(0x100)}, {0x3000, 0x100, dirty(0x80)}},
         dirty(0x180)},
    };
    for (const MergeCase &c : cases) {
        SCOPED_TRACE(c.what);
        std::vector<std::unique_ptr<VSMemoryRegion>> owned;
        VSMemoryObject object;
        for (const RegionSpec &shape : c.regions) {
            owned.push_back(makeRegion(shape));
            object.addRegion(owned.back().get(), c.pageSize);
        }
        object.calculateSizes();
        EXPECT_EQ(nodesOf(object), c.nodes);
        EXPECT_EQ(totalsOf(object), c.totals);
        EXPECT_EQ(object.memoryRegions().size(), c.regions.size());
    }
}

TEST(MemoryObject, NameComesFromTheFirstNamedRegion) {
    struct Case {
        std::vector<std::optional<std::string>> names;
        std::optional<std::string> expected;
    };
    const std::vector<Case> cases = {
        {{}, std::nullopt},
        {{std::nullopt}, std::nullopt},
        {{"first", "second"}, "first"},
        {{std::nullopt, "second", "third"}, "second"},
    };
    for (const Case &c : cases) {
        std::vector<std::unique_ptr<VSMemoryRegion>> owned;
        VSMemoryObject object;
        for (const auto &name : c.names) {
            owned.push_back(makeRegion({0, 0x4000, dirty(0)}));
            owned.back()->setName(name);
            object.addRegion(owned.back().get(), P);
        }
        EXPECT_EQ(object.name(), c.expected);
    }

    // A region without an object id is listed and may name the object.
    VSMemoryRegion unbacked;
    unbacked.setName("untagged");
    unbacked.setSize(0x4000);
    unbacked.setDirtySize(0x4000);
    VSMemoryObject object;
    object.addRegion(&unbacked, P);
    object.calculateSizes();
    EXPECT_EQ(object.name(), "untagged");
    ASSERT_EQ(object.memoryRegions().size(), 1u);
    EXPECT_EQ(*object.memoryRegions().begin(), &unbacked);
    EXPECT_EQ(totalsOf(object), Sizes{});
}

TEST(MemoryObject, TotalsFollowAdditionsOnlyAfterRecalculation) {
    auto first = makeRegion({0, 0x4000, dirty(0x4000)});
    auto second = makeRegion({0x10000, 0x4000, {0x2000, 0x1000, 0, 0, 0}});
    VSMemoryObject object;
    object.addRegion(first.get(), P);
    object.calculateSizes();
    object.calculateSizes();
    EXPECT_EQ(totalsOf(object), dirty(0x4000));

    object.addRegion(second.get(), P);
    EXPECT_EQ(totalsOf(object), dirty(0x4000)) << "totals are stored, not computed on read";
    object.calculateSizes();
    EXPECT_EQ(totalsOf(object), (Sizes{0x6000, 0x1000, 0, 0, 0}));
    object.calculateSizes();
    EXPECT_EQ(totalsOf(object), (Sizes{0x6000, 0x1000, 0, 0, 0}));

    // Adding the same region again keeps one entry and the same pages.
    object.addRegion(first.get(), P);
    object.calculateSizes();
    EXPECT_EQ(object.memoryRegions().size(), 2u);
    EXPECT_EQ(totalsOf(object), (Sizes{0x6000, 0x1000, 0, 0, 0}));
}

// Objects backing a large file mapped in many separate pieces hold long
// lists; releasing them must not recurse once per node.
TEST(MemoryObject, ReleasesAVeryLongRangeList) {
    constexpr std::uint64_t kNodes = 1'000'000;
    VSMemoryRegion region;
    region.setObject_id(7);
    region.setSize(0x1000);
    region.setDirtySize(0x1000);
    {
        VSMemoryObject object;
        // Descending offsets: every insertion lands in front, so this stays fast.
        for (std::uint64_t i = kNodes; i-- > 0;) {
            region.setOffset(i * 2 * P);
            object.addRegion(&region, P);
        }
        object.calculateSizes();
        EXPECT_EQ(object.totalDirtySize(), kNodes * 0x1000);
    }
    SUCCEED();
}

} // namespace
