#include "model/memory_category.h"

#include <algorithm>
#include <utility>

#include "model/assert.h"

VSMemoryCategory::VSMemoryCategory(std::string name, VSSegmentKind segment)
    : _name(std::move(name)), _segment(segment) {}

void VSMemoryCategory::addMemoryObject(VSMemoryObject *object) {
    VS_ASSERT(object != nullptr);
    if (_memoryObjects.insert(object)) {
        _addTotalsAndRegions(object);
    }
}

void VSMemoryCategory::addNewMemoryObject(VSMemoryObject *object) {
    _memoryObjects.appendNew(object);
    _addTotalsAndRegions(object);
}

void VSMemoryCategory::_addTotalsAndRegions(VSMemoryObject *object) {
    _totalDirtySize += object->totalDirtySize();
    _totalSwappedSize += object->totalSwappedSize();
    _totalCleanSize += object->totalCleanSize();
    _totalReclaimableSize += object->totalReclaimableSize();
    _totalWiredSize += object->totalWiredSize();

    const vs::RegionSet &regions = object->memoryRegions();
    if (_regionsDisjoint) {
        const bool ownsAll = std::all_of(regions.begin(), regions.end(),
                                         [object](const VSMemoryRegion *r) { return r->memoryObject() == object; });
        if (ownsAll) {
            if (_firstRegion == nullptr && !regions.empty()) {
                _firstRegion = *regions.begin();
            }
            _regionCount += static_cast<std::int32_t>(regions.size());
            return;
        }
        // From here on regions are counted through the set, filled in the
        // order the objects were added.
        _regionsDisjoint = false;
        for (VSMemoryObject *earlier : _memoryObjects) {
            if (earlier != object) {
                _memoryRegions.unionWith(earlier->memoryRegions());
            }
        }
    }
    _memoryRegions.unionWith(regions);
}

std::int32_t VSMemoryCategory::totalRegions() const {
    return _regionsDisjoint ? _regionCount : static_cast<std::int32_t>(_memoryRegions.size());
}

bool VSMemoryCategory::purgeableNonVolatile() const {
    const VSMemoryRegion *first =
        _regionsDisjoint ? _firstRegion : (_memoryRegions.empty() ? nullptr : *_memoryRegions.begin());
    return first != nullptr && first->purgeableNonVolatile();
}
