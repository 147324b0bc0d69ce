#pragma once

// The analysis driver. One run is one pass:
//
//   VSVestage vestage(std::move(targets));
//   auto source = VSVestage::installCancelHandler([&] { vestage.cancel(); ... });
//   vestage.gatherData();
//   if (source) source->cancel();
//   vestage.addOutputFormatter(std::make_unique<VSOutputFormatterText>(format, options));
//   vestage.printOutputVerbose(verbose, summarize);
//
// gatherData() lets every target read its memory in parallel, then files
// every region into the memory object that holds its pages (so that a page
// mapped by several regions or targets is counted once), sizes the objects
// and charges each target its vestage: the dirty plus swapped bytes of every
// distinct object it maps. printOutputVerbose() walks the report once and
// every formatter renders it.
//
// Object keys are only unique within one collection: the same number names
// different objects in the ordinary, text and linkedit collections. A
// copy-on-write region with dirty or swapped pages gets a key private to its
// target, since those pages are the target's own copies; an untouched
// copy-on-write mapping still merges with the other targets' mappings.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <unordered_map>
#include <vector>

#include "analysis/categories.h"
#include "analysis/interrupt_source.h"
#include "analysis/object_table.h"
#include "analysis/sharing.h"
#include "model/memory_object.h"
#include "output/output_formatter.h"
#include "targets/process.h"

class VSVestage {
public:
    using MemoryObjectTable = vs::MemoryObjectTable;
    using MemoryObjectList = std::vector<std::unique_ptr<VSMemoryObject>>;

    // The driver owns the targets, in the order given.
    explicit VSVestage(std::vector<std::unique_ptr<VSProcess>> processes);
    virtual ~VSVestage();

    VSVestage(const VSVestage &) = delete;
    VSVestage &operator=(const VSVestage &) = delete;

    // Gathers every target, highest pid first, on a pool sized to the
    // machine; then merges, sizes and computes the vestage map. Call once.
    void gatherData();

    // Stops the gathering early: targets not yet started are skipped.
    // Safe from any thread at any time.
    void cancel() { _earlyExit.store(true); }
    bool earlyExit() const { return _earlyExit.load(); }

    // Formatters are called in the order added (the text formatter first).
    void addOutputFormatter(std::unique_ptr<VSOutputFormatter> formatter);
    const std::vector<std::unique_ptr<VSOutputFormatter>> &outputFormatters() const { return _outputFormatters; }

    const std::vector<std::unique_ptr<VSProcess>> &processes() const { return _processes; }

    // Each target's vestage in bytes, by pid; filled by gatherData().
    const std::unordered_map<std::int32_t, std::uint64_t> &pidToVestage() const { return _pidToVestage; }

    // Sizes every memory object of the six collections.
    void calculateSizes();

    // The whole report through every formatter, ending with end() on each.
    // verbose adds the region listings first; summarize folds small and
    // image-segment categories into "Other".
    void printOutputVerbose(bool verbose, bool summarize);

    // The region listing of each process, in the given order, through the
    // formatters that implement it.
    void printSpanlistLikeOutputForProcesses(const std::vector<const VSProcess *> &processes);

    // Calls back on an ordinary thread for every SIGINT while the returned
    // source exists. Returns null, and leaves SIGINT alone, when standard
    // output is a terminal: an interrupt then ends the program as usual.
    static std::unique_ptr<vs::InterruptSource> installCancelHandler(std::function<void()> callback);

    // The run-wide physical-vestage breakdown switch, read from the kernel
    // setting every time. Linux has no such setting: it reads as off and
    // switching it on does nothing.
    static bool breakDownPhysVestage();
    static void setBreakDownPhysVestage(bool enabled);

    // ---- collections (empty again once the report has started) -------------
    const MemoryObjectTable &memoryObjects() const { return _memoryObjects; }
    const MemoryObjectTable &sharedCache64MemoryObjects() const { return _sharedCache64MemoryObjects; }
    const MemoryObjectTable &sharedCache32MemoryObjects() const { return _sharedCache32MemoryObjects; }
    const MemoryObjectTable &textMemoryObjects() const { return _textMemoryObjects; }
    const MemoryObjectTable &linkeditMemoryObjects() const { return _linkeditMemoryObjects; }
    const MemoryObjectList &uniqueMemoryObjects() const { return _uniqueMemoryObjects; }
    const MemoryObjectTable &kernelMemoryObjects() const { return _kernelMemoryObjects; }

    // ---- steps of the analysis, exposed for the report's tests -------------
    // Files one target's regions into the collections.
    void _addProcess(VSProcess &process);

    // Categories over every target: each object once, under the name of the
    // first region (in target order, then region order) that maps it.
    VSCategoryTable _categoriesForAllProcesses() const;
    // Categories of a collection of objects, keyed by the objects' names.
    VSCategoryTable _categoriesForObjects(std::span<VSMemoryObject *const> objects) const;
    // The table to print: with summarize, foldable categories go into
    // "Other". outTotal receives the sums over all input categories.
    static VSCategoryTable _summarizedCategoriesForCategories(VSCategoryTable categories, bool summarize,
                                                              VSCategoryTotals &outTotal);
    // Names by dirty + swapped, then reclaimable, then clean, largest first;
    // ties in name order.
    static VSSortedCategoryKeys _sortedKeysForCategories(const VSCategoryTable &categories);

    // Dirty plus swapped bytes of every distinct object the target maps.
    std::uint64_t _calculateVestageForProcess(const VSProcess &process) const;
    void _buildProcessToVestageMap();
    // Highest pid first; equal pids keep the driver's order.
    std::vector<VSProcess *> _getProcessListSortedByPidDesc() const;
    // Largest vestage first, then higher pid first.
    std::vector<VSProcess *> _getProcessListSortedByVestage() const;
    // The partition of all memory objects into process groups.
    std::unique_ptr<VSVestageSharingData> _sharingData() const;

protected:
    // Number of gathering workers; 0 means one per processor.
    void _setGatherWidth(unsigned width) { _gatherWidth = width; }

private:
    // Hands every object over to the sharing record and empties the six
    // collections.
    void _releaseMemoryObjectsTo(VSVestageSharingData &sharing);

    std::vector<std::unique_ptr<VSProcess>> _processes;
    std::unordered_map<std::int32_t, std::uint64_t> _pidToVestage;
    MemoryObjectTable _memoryObjects;
    MemoryObjectTable _sharedCache64MemoryObjects;
    MemoryObjectTable _sharedCache32MemoryObjects;
    MemoryObjectTable _textMemoryObjects;
    MemoryObjectTable _linkeditMemoryObjects;
    MemoryObjectList _uniqueMemoryObjects;
    MemoryObjectTable _kernelMemoryObjects;  // ordinary regions of the kernel target (pid 0)
    std::vector<std::unique_ptr<VSOutputFormatter>> _outputFormatters;
    std::atomic<bool> _earlyExit{false};
    unsigned _gatherWidth = 0;
    // True when every target was filed by gatherData, in processes order:
    // then each object's first region is the first one met in that order.
    bool _filedInProcessOrder = false;
};
