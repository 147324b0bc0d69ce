#pragma once

// One line of a report: a named group of memory objects with the sums of
// their de-duplicated sizes and the number of distinct regions behind them.
// The category copies an object's totals when the object is added (size
// the object first) and does not follow later changes.

#include <cstdint>
#include <string>

#include "model/memory_object.h"
#include "model/memory_region.h"
#include "model/pointer_set.h"

namespace vs {
using MemoryObjectSet = PointerSet<VSMemoryObject>;
}

class VSMemoryCategory {
public:
    VSMemoryCategory(std::string name, VSSegmentKind segment);

    // Adds the object once: its five totals to the category's and its
    // regions to the category's region set. A second addition does nothing.
    void addMemoryObject(VSMemoryObject *object);
    // The same for an object the caller knows is not in the category yet
    // (each object of a table goes to one category): no lookup.
    void addNewMemoryObject(VSMemoryObject *object);

    const std::string &name() const { return _name; }
    const vs::MemoryObjectSet &memoryObjects() const { return _memoryObjects; }
    VSSegmentKind segment() const { return _segment; }

    std::uint64_t totalDirtySize() const { return _totalDirtySize; }
    std::uint64_t totalSwappedSize() const { return _totalSwappedSize; }
    std::uint64_t totalCleanSize() const { return _totalCleanSize; }
    std::uint64_t totalReclaimableSize() const { return _totalReclaimableSize; }
    std::uint64_t totalWiredSize() const { return _totalWiredSize; }

    // Distinct regions of all added objects (one reached twice counts once).
    std::int32_t totalRegions() const;

    // The flag of one of the category's regions (the first added); false
    // when the category has no regions.
    bool purgeableNonVolatile() const;

private:
    void _addTotalsAndRegions(VSMemoryObject *object);

    std::string _name;
    vs::MemoryObjectSet _memoryObjects;
    std::uint64_t _totalDirtySize = 0;
    std::uint64_t _totalSwappedSize = 0;
    std::uint64_t _totalCleanSize = 0;
    std::uint64_t _totalReclaimableSize = 0;
    std::uint64_t _totalWiredSize = 0;
    VSSegmentKind _segment = VSSegmentUnknown;
    // The union of the added objects' regions. While every added object's
    // regions point back to that object, no region can be reached through
    // two objects, so a count and the first region tell all that is asked;
    // the set is only built once an object breaks that (shared report
    // tables hold objects with hundreds of regions, built for every member).
    std::int32_t _regionCount = 0;
    const VSMemoryRegion *_firstRegion = nullptr;
    bool _regionsDisjoint = true;
    vs::RegionSet _memoryRegions;
};
