#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <vector>

#include "model/memory_category.h"
#include "model/memory_object.h"
#include "model/memory_region.h"

namespace {

constexpr std::uint64_t P = 0x4000;

// Regions and objects of one small scenario; objects are sized after
// their regions are added, as the driver does.
struct World {
    std::vector<std::unique_ptr<VSMemoryRegion>> regions;
    std::vector<std::unique_ptr<VSMemoryObject>> objects;

    VSMemoryRegion *region(std::uint64_t offset, std::uint64_t dirty, std::uint64_t swapped,
                           std::uint64_t objectId = 1, bool purgeable = false) {
        auto r = std::make_unique<VSMemoryRegion>();
        r->setOffset(offset);
        r->setSize(P);
        r->setDirtySize(dirty);
        r->setSwappedSize(swapped);
        r->setCleanNonSpecSize(P - dirty);
        r->setReclaimableSize(dirty / 2);
        r->setWiredSize(dirty / 4);
        r->setObject_id(objectId);
        r->setPurgeableNonVolatile(purgeable);
        regions.push_back(std::move(r));
        return regions.back().get();
    }

    VSMemoryObject *object(std::vector<VSMemoryRegion *> members) {
        auto o = std::make_unique<VSMemoryObject>();
        for (VSMemoryRegion *r : members) {
            o->addRegion(r, P);
        }
        o->calculateSizes();
        objects.push_back(std::move(o));
        return objects.back().get();
    }

    // Points the object's regions back at it, as the driver does after merging.
    VSMemoryObject *filed(VSMemoryObject *o) {
        for (VSMemoryRegion *r : o->memoryRegions()) {
            r->setMemoryObject(o);
        }
        return o;
    }
};

struct Expected {
    std::uint64_t dirty, swapped, clean, reclaimable, wired;
    std::int32_t regions;
    std::size_t objects;
    bool purgeable;
};

void expectCategory(const VSMemoryCategory &c, const Expected &e) {
    EXPECT_EQ(c.totalDirtySize(), e.dirty);
    EXPECT_EQ(c.totalSwappedSize(), e.swapped);
    EXPECT_EQ(c.totalCleanSize(), e.clean);
    EXPECT_EQ(c.totalReclaimableSize(), e.reclaimable);
    EXPECT_EQ(c.totalWiredSize(), e.wired);
    EXPECT_EQ(c.totalRegions(), e.regions);
    EXPECT_EQ(c.memoryObjects().size(), e.objects);
    EXPECT_EQ(c.purgeableNonVolatile(), e.purgeable);
}

TEST(MemoryCategory, SumsDistinctObjectsAndRegions) {
    struct Case {
        const char *what;
        // Builds the objects and returns them in the order to add them.
        std::vector<VSMemoryObject *> (*build)(World &);
        Expected expected;
    };
    const std::vector<Case> cases = {
        {"no objects", [](World &) { return std::vector<VSMemoryObject *>{}; }, {0, 0, 0, 0, 0, 0, 0, false}},
        {"same object twice changes nothing the second time",
         [](World &w) {
             VSMemoryObject *o = w.object({w.region(0, 0x2000, 0x1000), w.region(P * 2, 0x1000, 0)});
             return std::vector<VSMemoryObject *>{o, o};
         },
         {0x3000, 0x1000, 0x5000, 0x1800, 0xC00, 2, 1, false}},
        {"two objects sharing no region add up",
         [](World &w) {
             VSMemoryObject *a = w.object({w.region(0, 0x4000, 0)});
             VSMemoryObject *b = w.object({w.region(0, 0x1000, 0x2000, 2), w.region(P * 4, 0, 0x1000, 2)});
             return std::vector<VSMemoryObject *>{a, b};
         },
         {0x5000, 0x3000, 0x7000, 0x2800, 0x1400, 3, 2, false}},
        {"object without object ids still counts its regions",
         [](World &w) {
             VSMemoryObject *o = w.object({w.region(0, 0x4000, 0x4000, 0), w.region(P, 0x4000, 0, 0)});
             return std::vector<VSMemoryObject *>{o};
         },
         {0, 0, 0, 0, 0, 2, 1, false}},
        {"a region reached through two objects counts once",
         [](World &w) {
             VSMemoryRegion *shared = w.region(0, 0x4000, 0);
             VSMemoryObject *a = w.object({shared});
             VSMemoryObject *b = w.object({shared, w.region(P * 2, 0, 0)});
             return std::vector<VSMemoryObject *>{a, b};
         },
         {0x8000, 0, 0x4000, 0x4000, 0x2000, 2, 2, false}},
        {"objects filed by the driver: regions counted per object",
         [](World &w) {
             VSMemoryObject *a = w.filed(w.object({w.region(0, 0x4000, 0), w.region(P * 2, 0, 0)}));
             VSMemoryObject *b = w.filed(w.object({w.region(0, 0x1000, 0, 2, true)}));
             return std::vector<VSMemoryObject *>{a, b, a};
         },
         {0x5000, 0, 0x7000, 0x2800, 0x1400, 3, 2, false}},
        {"a filed region reached again through a later object counts once",
         [](World &w) {
             VSMemoryRegion *shared = w.region(0, 0x4000, 0);
             VSMemoryObject *a = w.filed(w.object({shared, w.region(P * 2, 0, 0)}));
             VSMemoryObject *b = w.object({w.region(P * 4, 0, 0), shared});
             VSMemoryObject *c = w.filed(w.object({w.region(0, 0, 0, 3)}));
             return std::vector<VSMemoryObject *>{a, b, c};
         },
         {0x8000, 0, 0xC000, 0x4000, 0x2000, 4, 3, false}},
        {"purgeable flag taken from the first region of a filed object",
         [](World &w) {
             VSMemoryObject *none = w.filed(w.object({}));
             VSMemoryObject *o = w.filed(w.object({w.region(0, 0x4000, 0, 1, true), w.region(P, 0, 0)}));
             return std::vector<VSMemoryObject *>{none, o};
         },
         {0x4000, 0, 0x4000, 0x2000, 0x1000, 2, 2, true}},
        {"purgeable flag taken from the regions",
         [](World &w) {
             VSMemoryObject *o = w.object({w.region(0, 0x4000, 0, 1, true)});
             return std::vector<VSMemoryObject *>{o};
         },
         {0x4000, 0, 0, 0x2000, 0x1000, 1, 1, true}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        World world;
        VSMemoryCategory category("MALLOC_SMALL", VSSegmentNone);
        for (VSMemoryObject *o : c.build(world)) {
            category.addMemoryObject(o);
        }
        EXPECT_EQ(category.name(), "MALLOC_SMALL");
        EXPECT_EQ(category.segment(), VSSegmentNone);
        expectCategory(category, c.expected);
    }
}

TEST(MemoryCategory, CopiesTotalsAtTheMomentOfAddition) {
    World world;
    VSMemoryObject *object = world.object({world.region(0, 0x1000, 0)});
    VSMemoryCategory category("__TEXT /usr/lib/libc.so.6", VSSegmentText);
    category.addMemoryObject(object);

    object->addRegion(world.region(P * 8, 0x2000, 0), P);
    object->calculateSizes();
    category.addMemoryObject(object); // already present: ignored

    EXPECT_EQ(object->totalDirtySize(), 0x3000u);
    EXPECT_EQ(category.totalDirtySize(), 0x1000u);
    EXPECT_EQ(category.segment(), VSSegmentText);
}

} // namespace
