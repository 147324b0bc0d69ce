#pragma once

// The interface every report format implements. The driver walks the
// report once and calls each operation on every formatter in the order they
// were added; a formatter only renders what it is handed and keeps no
// reference to it after the call returns.
//
// Two operations are optional: the driver asks implementsOperation() first
// and leaves the call out for a formatter that answers false, so a
// formatter that has no use for them (the JSON document) never sees them.

#include <cstdint>
#include <string>
#include <vector>

#include "analysis/categories.h"
#include "analysis/sharing.h"

class VSAuxDataDictionary;
class VSMemoryRegion;
class VSProcess;

enum class VSOptionalFormatterOperation {
    printSpanlistLikeOutputForProcess,
    printSharedCategories,
};

class VSOutputFormatter {
public:
    virtual ~VSOutputFormatter() = default;

    // Whether the optional operation is implemented; false by default.
    virtual bool implementsOperation(VSOptionalFormatterOperation operation) const;

    // Opens a process's section.
    virtual void printProcessHeader(const VSProcess &process) = 0;
    // Closes the header opened by printProcessHeader().
    virtual void endProcessHeader(const VSProcess &process) = 0;
    // The process's vestage in bytes; only for processes without errors.
    virtual void printProcessTotal(std::uint64_t total, const VSProcess &process) = 0;
    // The memory the current process alone maps.
    virtual void printProcessCategories(const VSCategoryTable &categories,
                                        const VSSortedCategoryKeys &sortedKeys,
                                        const VSCategoryTotals &total) = 0;
    // The current process's auxiliary data; null when it has none.
    virtual void printProcessAuxData(const VSAuxDataDictionary *auxData) = 0;
    // Processes named in listing order; global errors are tied to no process.
    virtual void printProcessesWithWarnings(const std::vector<const VSProcess *> &processesWithWarnings,
                                            const std::vector<const VSProcess *> &processesWithErrors,
                                            const std::vector<std::string> &globalErrors) = 0;
    // How the figures were obtained, where the reader should know (never
    // errors). Called once, possibly with no notes.
    virtual void printNotes(const std::vector<std::string> &) {}
    // The table over all targets.
    virtual void printSummaryCategories(const VSCategoryTable &categories,
                                        const VSSortedCategoryKeys &sortedKeys,
                                        const VSCategoryTotals &total, bool hadErrors) = 0;
    // Auxiliary data merged over all processes; null when nothing survived.
    virtual void printGlobalAuxData(const VSAuxDataDictionary *auxData) = 0;
    // The last call of a report.
    virtual void end() = 0;

    // Optional: one process's regions, in ascending start order.
    virtual void printSpanlistLikeOutputForProcess(const VSProcess &process,
                                                   const std::vector<const VSMemoryRegion *> &regions);
    // Optional: memory the process shares with exactly the other members of
    // sharedWith (which includes the process itself).
    virtual void printSharedCategories(const VSCategoryTable &categories,
                                       const VSSortedCategoryKeys &sortedKeys,
                                       const VSProcessGroup &sharedWith, const VSProcess &process,
                                       const VSCategoryTotals &total);
};
