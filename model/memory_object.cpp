#include "model/memory_object.h"

#include <algorithm>
#include <utility>

#include "model/assert.h"

namespace {

struct PageRange {
    std::uint64_t start;
    std::uint64_t end;
};

// [offset, offset + size) widened to whole pages of pageSize.
PageRange pageRounded(std::uint64_t offset, std::uint64_t size, std::uint64_t pageSize) {
    const std::uint64_t mask = ~(pageSize - 1);
    return {offset & mask, (offset + pageSize - 1 + size) & mask};
}

// The sum of two sizes less the page bytes the ranges share, but never
// below the larger of the two: overlap only bounds what they have in common.
std::uint64_t mergedSize(std::uint64_t a, std::uint64_t b, std::uint64_t overlap) {
    const std::uint64_t sum = a + b;
    return std::max(sum - std::min(sum, overlap), std::max(a, b));
}

std::unique_ptr<VSRangeListNode> nodeFor(const VSMemoryRegion &region) {
    auto node = std::make_unique<VSRangeListNode>();
    node->offset = region.offset();
    node->size = region.size();
    node->cleanSize = region.cleanNonSpecSize();
    node->dirtySize = region.dirtySize();
    node->swappedSize = region.swappedSize();
    node->reclaimableSize = region.reclaimableSize();
    node->wiredSize = region.wiredSize();
    return node;
}

} // namespace

void VSMemoryObject::_listUnlistedRegion() const {
    if (_unlistedRegion != nullptr) {
        VS_ASSERT(!_rangeListHead);
        _rangeListHead = nodeFor(*_unlistedRegion);
        _unlistedRegion = nullptr;
    }
}

VSMemoryObject::~VSMemoryObject() {
    // Unlink node by node: letting the unique_ptr chain destroy itself
    // would recurse once per node.
    std::unique_ptr<VSRangeListNode> node = std::move(_rangeListHead);
    while (node) {
        node = std::move(node->next);
    }
}

std::optional<std::string> VSMemoryObject::name() const {
    return _name != nullptr ? std::optional<std::string>(*_name) : std::nullopt;
}

void VSMemoryObject::setName(const std::optional<std::string> &name) {
    _name = name ? vs::internedString(*name) : nullptr;
}

void VSMemoryObject::addRegion(VSMemoryRegion *region, std::uint64_t pageSize) {
    VS_ASSERT(region != nullptr);
    VS_ASSERT(pageSize != 0 && (pageSize & (pageSize - 1)) == 0);

    _accurateSizes = false;
    if (_name == nullptr) {
        _name = region->sharedName();
    }
    _memoryRegions.insert(region);
    if (region->object_id() == 0) {
        return;
    }

    if (!_rangeListHead && _unlistedRegion == nullptr) {
        _unlistedRegion = region;
        return;
    }
    _listUnlistedRegion();
    std::unique_ptr<VSRangeListNode> node = nodeFor(*region);

    if (!_rangeListHead) {
        _rangeListHead = std::move(node);
        return;
    }

    // The region's page range stays fixed for the whole insertion, also
    // after the node has grown by merging.
    const PageRange regionPages = pageRounded(node->offset, node->size, pageSize);

    // afterBefore: the link following the last node wholly before the
    // region; following: the first node wholly after it (or null).
    std::unique_ptr<VSRangeListNode> *afterBefore = &_rangeListHead;
    const VSRangeListNode *following = nullptr;
    for (VSRangeListNode *current = _rangeListHead.get(); current; current = current->next.get()) {
        const PageRange pages = pageRounded(current->offset, current->size, pageSize);
        if (pages.end < regionPages.start) {
            afterBefore = &current->next;
        } else if (pages.start > regionPages.end) {
            following = current;
            break;
        }
    }

    // Every node between the two overlaps the region or touches it at a
    // page boundary: fold it into the new node, in list order.
    while (afterBefore->get() != following) {
        std::unique_ptr<VSRangeListNode> overlapping = std::move(*afterBefore);
        *afterBefore = std::move(overlapping->next);

        const PageRange pages = pageRounded(overlapping->offset, overlapping->size, pageSize);
        const std::uint64_t low = std::max(regionPages.start, pages.start);
        const std::uint64_t high = std::min(regionPages.end, pages.end);
        const std::uint64_t overlap = high > low ? high - low : 0;

        node->cleanSize = mergedSize(node->cleanSize, overlapping->cleanSize, overlap);
        node->dirtySize = mergedSize(node->dirtySize, overlapping->dirtySize, overlap);
        node->swappedSize = mergedSize(node->swappedSize, overlapping->swappedSize, overlap);
        node->reclaimableSize = mergedSize(node->reclaimableSize, overlapping->reclaimableSize, overlap);
        node->wiredSize = mergedSize(node->wiredSize, overlapping->wiredSize, overlap);

        const std::uint64_t start = std::min(node->offset, overlapping->offset);
        const std::uint64_t end = std::max(node->offset + node->size, overlapping->offset + overlapping->size);
        node->offset = start;
        node->size = end - start;
    }

    node->next = std::move(*afterBefore);
    *afterBefore = std::move(node);
}

void VSMemoryObject::calculateSizes() {
    if (_accurateSizes) {
        return;
    }
    _totalDirtySize = 0;
    _totalCleanSize = 0;
    _totalReclaimableSize = 0;
    _totalSwappedSize = 0;
    _totalWiredSize = 0;
    if (_unlistedRegion != nullptr) {
        _totalDirtySize = _unlistedRegion->dirtySize();
        _totalCleanSize = _unlistedRegion->cleanNonSpecSize();
        _totalReclaimableSize = _unlistedRegion->reclaimableSize();
        _totalSwappedSize = _unlistedRegion->swappedSize();
        _totalWiredSize = _unlistedRegion->wiredSize();
    }
    for (const VSRangeListNode *node = _rangeListHead.get(); node; node = node->next.get()) {
        _totalDirtySize += node->dirtySize;
        _totalCleanSize += node->cleanSize;
        _totalReclaimableSize += node->reclaimableSize;
        _totalSwappedSize += node->swappedSize;
        _totalWiredSize += node->wiredSize;
    }
    _accurateSizes = true;
}
