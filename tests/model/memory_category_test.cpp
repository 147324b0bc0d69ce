#include <gtest/gtest.h>

#include <array>
#include <cstdint>
#include <memory>
#include <vector>

#include "model/memory_category.h"
#include "model/memory_object.h"
#include "model/memory_region.h"

namespace {

constexpr std::uint64_t P = 0x4000;

// One small scenario; objects are sized after their regions are added.
struct World {
    std::vector<std::unique_ptr<VSMemoryRegion>> regions;
    std::vector<std::unique_ptr<VSMemoryObject>> objects;

    VSMemoryRegion *region(std::uint64_t offset, std::uint64_t dirty, std::uint64_t objectId = 1,
                           bool purgeable = false) {
        auto &r = regions.emplace_back(std::make_unique<VSMemoryRegion>());
        r->setOffset(offset);
        r->setSize(P);
        r->setDirtySize(dirty);
        r->setCleanNonSpecSize(P - dirty);
        r->setObject_id(objectId);
        r->setPurgeableNonVolatile(purgeable);
        return r.get();
    }
    // With `filed`, the regions point back at the object, as the driver
    // leaves them after merging.
    VSMemoryObject *object(std::vector<VSMemoryRegion *> members, bool filed = false) {
        auto &o = objects.emplace_back(std::make_unique<VSMemoryObject>());
        for (VSMemoryRegion *r : members) {
            o->addRegion(r, P);
            if (filed) {
                r->setMemoryObject(o.get());
            }
        }
        o->calculateSizes();
        return o.get();
    }
};

TEST(MemoryCategory, SumsDistinctObjectsAndRegions) {
    struct Case {
        const char *what;
        std::vector<VSMemoryObject *> (*build)(World &); // the objects, in the order to add them
        std::array<std::uint64_t, 4> expected; // dirty, clean, regions, objects
        bool purgeable;
    };
    const std::vector<Case> cases = {
        {"same object twice changes nothing the second time",
         [](World &w) {
             VSMemoryObject *o = w.object({w.region(0, 0x2000), w.region(P * 2, 0x1000)});
             return std::vector<VSMemoryObject *>{o, o};
         },
         {0x3000, 0x5000, 2, 1}, false},
        {"a region reached through two objects counts once",
         [](World &w) {
             VSMemoryRegion *shared = w.region(0, 0x4000);
             return std::vector<VSMemoryObject *>{w.object({shared}), w.object({shared, w.region(P * 2, 0)})};
         },
         {0x8000, 0x4000, 2, 2}, false},
        {"a filed region reached again through a later object counts once",
         [](World &w) {
             VSMemoryRegion *shared = w.region(0, 0x4000);
             VSMemoryObject *a = w.object({shared, w.region(P * 2, 0)}, true);
             VSMemoryObject *b = w.object({w.region(P * 4, 0), shared});
             return std::vector<VSMemoryObject *>{a, b, w.object({w.region(0, 0, 3)}, true), a};
         },
         {0x8000, 0xC000, 4, 3}, false},
        {"purgeable flag taken from the first region of a filed object",
         [](World &w) {
             return std::vector<VSMemoryObject *>{
                 w.object({}, true), w.object({w.region(0, 0x4000, 1, true), w.region(P, 0)}, true)};
         },
         {0x4000, 0x4000, 2, 2}, true},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        World world;
        VSMemoryCategory category("MALLOC_SMALL", VSSegmentNone);
        for (VSMemoryObject *o : c.build(world)) {
            category.addMemoryObject(o);
        }
        EXPECT_EQ((std::array<std::uint64_t, 4>{category.totalDirtySize(), category.totalCleanSize(),
                                                 static_cast<std::uint64_t>(category.totalRegions()),
                                                 category.memoryObjects().size()}),
                  c.expected);
        EXPECT_EQ(category.purgeableNonVolatile(), c.purgeable);
    }
}

} // namespace
