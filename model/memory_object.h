#pragma once

// One kernel memory object as seen from all targets at once.
//
// Pages are de-duplicated in the object's own offset space: every region
// brings its offset into the object, its length and its page-class sizes,
// and the object keeps a sorted list of disjoint ranges. Overlap is judged
// on whole pages (start rounded down, end rounded up to the page size of
// the region's target), so two ranges that merely touch at a page boundary
// collapse into one node, while each node keeps its exact byte range.
// When ranges overlap, a size becomes the sum less the shared page bytes,
// but never less than the larger of the two (the "max rule"): the overlap
// is an upper bound on what the two can have in common.
//
// The object refers to its regions without owning them (their target owns
// them); the regions must outlive the object's use and keep their offset,
// size and page-class sizes once added (the first one is read when the
// object is sized).

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "model/block_pool.h"
#include "model/memory_region.h"
#include "model/pointer_set.h"

// One disjoint range of the object's offset space with the bytes of each
// page class attributed to it.
struct VSRangeListNode {
    static void *operator new(std::size_t size) { return vs::BlockPool<VSRangeListNode>::allocate(size); }
    static void operator delete(void *p, std::size_t size) { vs::BlockPool<VSRangeListNode>::deallocate(p, size); }

    std::uint64_t offset = 0;
    std::uint64_t size = 0; // exact, not rounded to pages
    std::uint64_t cleanSize = 0;
    std::uint64_t dirtySize = 0;
    std::uint64_t swappedSize = 0;
    std::uint64_t reclaimableSize = 0;
    std::uint64_t wiredSize = 0;
    std::unique_ptr<VSRangeListNode> next;
};

namespace vs {
using RegionSet = PointerSet<VSMemoryRegion>;
}

class VSMemoryObject {
public:
    // Most regions of a run get an object of their own: they, and their
    // range-list nodes, come from pools.
    static void *operator new(std::size_t size) { return vs::BlockPool<VSMemoryObject>::allocate(size); }
    static void operator delete(void *p, std::size_t size) { vs::BlockPool<VSMemoryObject>::deallocate(p, size); }

    VSMemoryObject() = default;
    ~VSMemoryObject();
    VSMemoryObject(const VSMemoryObject &) = delete;
    VSMemoryObject &operator=(const VSMemoryObject &) = delete;

    // Records the region and merges its range into the range list. pageSize
    // is the page size of the region's target, a power of two. A region with
    // object_id 0 is recorded (and may name the object) but adds no bytes.
    // Makes the totals stale until the next calculateSizes().
    void addRegion(VSMemoryRegion *region, std::uint64_t pageSize);

    // Brings the five totals up to date from the range list; does nothing
    // when they already are.
    void calculateSizes();

    // Meaningful after calculateSizes() and until the next addRegion().
    std::uint64_t totalDirtySize() const { return _totalDirtySize; }
    std::uint64_t totalCleanSize() const { return _totalCleanSize; }
    std::uint64_t totalReclaimableSize() const { return _totalReclaimableSize; }
    std::uint64_t totalSwappedSize() const { return _totalSwappedSize; }
    std::uint64_t totalWiredSize() const { return _totalWiredSize; }

    // Name of the first added region that had one; nullopt until then.
    std::optional<std::string> name() const;
    void setName(const std::optional<std::string> &name);
    // The same without a copy: the run-wide shared string, or null.
    const std::string *sharedName() const { return _name; }

    // Every region added, in the order of first addition (non-owning).
    const vs::RegionSet &memoryRegions() const { return _memoryRegions; }
    void setMemoryRegions(vs::RegionSet regions) { _memoryRegions = std::move(regions); }

    // The range list, for inspection (tests, debugging): first node or null.
    // Not for use while another thread reads the object.
    const VSRangeListNode *rangeListHead() const {
        _listUnlistedRegion();
        return _rangeListHead.get();
    }

private:
    vs::RegionSet _memoryRegions;
    std::uint64_t _totalDirtySize = 0;
    std::uint64_t _totalCleanSize = 0;
    std::uint64_t _totalReclaimableSize = 0;
    std::uint64_t _totalSwappedSize = 0;
    std::uint64_t _totalWiredSize = 0;
    const std::string *_name = nullptr;
    // Makes the unlisted region's node, if there is one.
    void _listUnlistedRegion() const;

    mutable std::unique_ptr<VSRangeListNode> _rangeListHead;
    // Most objects only ever have one region, whose range needs no merging:
    // its node is only made when a second one comes, and until then the
    // sizes are the region's own.
    mutable VSMemoryRegion *_unlistedRegion = nullptr;
    bool _accurateSizes = false;
};
