#include "model/memory_category.h"

#include <utility>

#include "model/assert.h"

VSMemoryCategory::VSMemoryCategory(std::string name, VSSegmentKind segment)
    : _name(std::move(name)), _segment(segment) {}

void VSMemoryCategory::addMemoryObject(VSMemoryObject *object) {
    VS_ASSERT(object != nullptr);
    if (!_memoryObjects.insert(object)) {
        return;
    }
    _totalDirtySize += object->totalDirtySize();
    _totalSwappedSize += object->totalSwappedSize();
    _totalCleanSize += object->totalCleanSize();
    _totalReclaimableSize += object->totalReclaimableSize();
    _totalWiredSize += object->totalWiredSize();
    _memoryRegions.unionWith(object->memoryRegions());
}

std::int32_t VSMemoryCategory::totalRegions() const {
    return static_cast<std::int32_t>(_memoryRegions.size());
}

bool VSMemoryCategory::purgeableNonVolatile() const {
    return !_memoryRegions.empty() && (*_memoryRegions.begin())->purgeableNonVolatile();
}
