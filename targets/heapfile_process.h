#pragma once

// A heapfile standing in for a live process. It is a VSUserProcess whose
// walk replays the regions recorded in the file instead of asking the
// kernel; naming, page classification, categories and reports are those of
// a live process.
//
// What differs from a live target:
// - nothing is opened and nothing live is asked once the target exists:
//   it is never alive, so failures are errors, mapped-file paths come from
//   the file and there is no "Kernel memory";
// - page size, physical vestage and the breakdown mode are the recorded
//   ones; the idle-exit state is always unknown;
// - anonymous memory is not recalculated as all dirty: the file says what
//   was dirty;
// - images are rebuilt during the walk: a region whose type names an image
//   segment ("__TEXT", "__DATA...", "__LINKEDIT") becomes an image covering
//   exactly that region just before the region is named;
// - the shared cache region follows from the recorded description, and its
//   pieces take their dirty and swapped bytes from the file instead of
//   page queries (the counters of such regions are stored as bytes).
//
// The target keeps the recorded pid, so it equals any other target of that
// pid; the run sequence keys heapfile targets apart (cli/heapfile_arguments.h).

#include <cstdint>
#include <memory>
#include <string>

#include "targets/heapfile_format.h"
#include "targets/user_process.h"

class VSHeapfileProcess : public VSUserProcess {
public:
    VSHeapfileProcess() = default;

    // Reads and checks the file at `path` and builds the target. Null when
    // the file cannot be read (the system's error), is no usable heapfile
    // (the reader's error) or names no known platform (code 2 of
    // vs::kVestageErrorDomain); the error goes to `error` when one is given.
    static std::unique_ptr<VSHeapfileProcess> processWithHeapfile(const std::string &path,
                                                                  vs::HeapfileError *error = nullptr);

    // The reader opened on the file, kept for the target's whole life.
    const std::shared_ptr<const VSHeapfileReader> &graph() const { return _graph; }
    void setGraph(std::shared_ptr<const VSHeapfileReader> graph) { _graph = std::move(graph); }

    bool _isAlive() const override { return false; }
    // The mode the file was written with, not the run-wide switch.
    bool breakDownPhysVestage() const override;

protected:
    bool initWithHeapfile(const std::string &path, vs::HeapfileError *error);

    uint64_t _gatherPageSize() override;
    bool _populateTask() override { return true; }
    void _gatherPhysVestage() override;
    // Images come from the walk itself.
    void _gatherImageData() override {}
    void enumerateRegions(const RegionCallback &callback) override;
    // Shared cache pieces: dirty and swapped bytes straight from the record,
    // where the walk stored them as bytes.
    bool _populateMemoryRegionWithPageQueries(VSMemoryRegion &region, const VSRegionInfo &info) override;

    // The record the walk hands on for one recorded region.
    VSRegionInfo _regionInfoForHeapfileRegion(const VSHeapfileRegion &region) const;

private:
    std::shared_ptr<const VSHeapfileReader> _graph;
};

namespace vs {

// The largest heapfile read: a million regions at about 400 bytes each.
inline constexpr uint64_t kMaxHeapfileSize = uint64_t{1} << 30;

// Reads a whole heapfile: a regular file of at most kMaxHeapfileSize bytes.
// nullopt with the system's error (domain kPosixErrorDomain, the errno as
// code, a printable reason as description) when it cannot be read.
std::optional<std::string> readWholeFile(const std::string &path, HeapfileError *error);

}  // namespace vs
