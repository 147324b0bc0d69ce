#pragma once

// A live user process as a target. At construction it opens the process's
// task and records the process-wide counters (kernel memory, physical
// vestage, idle-exit state); gatherData() lists its images and walks its
// address space into classified regions.
//
// The walk. Regions come from the kernel in ascending address order. A
// region outside the shared cache region takes its page-class sizes from
// the counters of its record. The shared cache region is taken as one
// top-level range and cut along the images the process has loaded there;
// the gaps between images are "unused" areas. Pieces are cut at image
// boundaries that need not fall on page boundaries, so a page can belong to
// two neighbouring pieces: it is queried once, its bytes are split by
// extent, and its class is remembered for the neighbour. Unused areas are
// never queried; they are credited with their share of a boundary page when
// the next classified piece queries it.
//
// Platforms without a shared cache region (Linux) report base 0 and size 0:
// the walk then only uses region_recurse and never asks the top-level map.

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "model/image.h"
#include "targets/process.h"

class VSUserProcess : public VSProcess {
public:
    // Called once per walked range with its start, size, record, purgeable
    // state (VSPurgeableState) and the mapped file's path (if known).
    // Returning true stops the walk.
    using RegionCallback = std::function<bool(uint64_t start, uint64_t size, VSRegionInfo &info,
                                              int32_t purgeableState, const std::optional<std::string> &path)>;

    VSUserProcess() = default;
    // Releases the task handle this target opened itself.
    ~VSUserProcess() override;

    // Images, then regions; sets memoryRegions also when the walk stopped
    // early (the regions found so far).
    void gatherData() override;
    bool prepareGatherData() override;
    // "phys_vestage" and "phys_vestage_peak" when the physical vestage is
    // known, "Kernel memory" {"KPRVT", "KSHRD"} while alive; null when empty.
    std::shared_ptr<const VSAuxDataDictionary> auxData() const override;
    bool _isAlive() const override { return true; }

    // ---- state --------------------------------------------------------------------
    // Image segments in ascending order of start after gathering.
    const VSImageList &images() const { return _images; }
    VSTaskHandle task() const { return _task; }
    uint64_t sharedRegionBase() const { return _sharedRegionBase; }
    uint64_t sharedRegionSize() const { return _sharedRegionSize; }
    uint32_t sharedRegionAlignmentSize() const { return _sharedRegionAlignmentSize; }
    uint64_t phys_vestage() const { return _phys_vestage; }
    uint64_t phys_vestage_peak() const { return _phys_vestage_peak; }
    bool anonymousDirtyRecalculation() const { return _anonymousDirtyRecalculation; }
    int64_t kprvt() const { return _kprvt; }
    int64_t kshrd() const { return _kshrd; }

protected:
    // Sets the recalculation flag, runs the base set-up (task, name, page
    // size), then locates the shared cache region from the target's
    // platform code and reads kernel memory, physical vestage and idle-exit
    // state.
    bool initWithBsdInfo(const VSBsdInfo &info) override;
    // Opens the task; on refusal reports it on standard error and as the
    // global error "task_handle_for_pid [pid] text".
    bool _populateTask() override;

    // ---- the walk ---------------------------------------------------------------------
    // Walks the whole address space once, in ascending order. Ends quietly at
    // the end of the address space or when the callback says stop; a kernel
    // failure is reported and recorded before the walk ends.
    virtual void enumerateRegions(const RegionCallback &callback);
    // Start of the last region below the shared cache region, found by
    // bisection to within 16 MiB; 0 when none was found or there is no
    // shared cache region (then nothing is asked).
    uint64_t _lastNonSharedCacheRegion();
    // Cuts one range of the shared cache region into image pieces and
    // unused areas, appending them. False when a page query failed (the
    // pieces made so far are appended).
    bool _addRegionsToArray(VSMemoryRegionList &regions, uint64_t start, uint64_t size, const VSRegionInfo &info,
                            VSImageEnumerator &images);
    // Records a kernel failure: a warning ending in " (process exited)" or
    // " (zombie)" when `code` is what the query answers for a gone process
    // and the process is indeed gone, an error otherwise.
    void _processMachVMError(VSReturnCode code, VSReturnCode expectedOnExit);
    // Sets the shared cache region for a platform code; false (with a
    // message on standard error) for an unknown code.
    bool _setSharedRegionFromPlatform(uint64_t platformCode);

    // ---- page classification ----------------------------------------------------------
    // Sets dirtySize and swappedSize of a shared cache piece from its pages'
    // dispositions. Pieces must come in ascending order with both sizes
    // still 0. False after a failed query (already recorded).
    virtual bool _populateMemoryRegionWithPageQueries(VSMemoryRegion &region, const VSRegionInfo &info);
    // Sizes of a region outside the shared cache region from its record.
    void _applyRecordRules(VSMemoryRegion &region, const VSRegionInfo &info, int32_t purgeableState,
                           bool breakDown) const;

    // ---- gathering steps ---------------------------------------------------------------
    void _gatherMemoryData();
    virtual void _gatherImageData();
    void _gatherKernelMemory();
    virtual void _gatherPhysVestage();
    virtual void _gatherIdleExitStatus();
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);

    VSImageList _images;
    VSTaskHandle _task = vs::kTaskHandleNone;
    uint64_t _sharedRegionBase = 0;
    uint64_t _sharedRegionSize = 0;
    uint32_t _sharedRegionAlignmentSize = 0;
    uint64_t _phys_vestage = 0;
    uint64_t _phys_vestage_peak = 0;
    bool _anonymousDirtyRecalculation = true;
    int64_t _kprvt = 0;
    int64_t _kshrd = 0;

    // Page classification state of one walk (ascending order only).
    uint64_t _cachedDispositionAddress = 0;
    int32_t _cachedDisposition = 0;
    // Whether a boundary page has been remembered at all: address 0 is a
    // valid page, so the address alone cannot tell.
    bool _hasCachedDisposition = false;
    // An unused area whose last page is shared with the next piece and has
    // not been classified yet. Points into the walk's own region list.
    VSMemoryRegion *_pendingUnusedSharedRegion = nullptr;

private:
    void _walkFailed(const char *label, VSReturnCode code);
    void _classifyPages(VSMemoryRegion &region, uint64_t pageCount, VSMemoryRegion *nextPending);

    // True when this target opened _task and must give it back.
    bool _ownsTask = false;
    // One word per page of the region being classified; reused, on the heap.
    std::vector<int32_t> _dispositions;
};
