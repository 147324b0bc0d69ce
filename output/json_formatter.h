#pragma once

// The report as one JSON document. Nothing is printed while the driver walks
// the report: the document is built in memory and written in one piece by
// end(). Every figure is an exact byte count whatever the text report's
// format, and the document says so itself ("unit" "byte", "bytes per unit" 1).
//
// end() replaces the file atomically: the document goes to a temporary file
// beside the target, which is renamed over it only once completely written.
// A failed write therefore never leaves a truncated document where a good
// one was. A failure prints one line on standard error and is otherwise
// ignored: the text report has been flushed by then and the run ends as
// usual, so nothing here exits or throws.

#include <cstdint>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "output/output_formatter.h"

class VSOutputFormatterJSON final : public VSOutputFormatter {
public:
    // Starts the document with its initial values; "page size" is the
    // kernel's until the first process header, and "phys_vestage_breakdown"
    // is present (true) only when the breakdown switch reads on now. Reads
    // the installed platform, so construct it after the platform is set.
    explicit VSOutputFormatterJSON(std::string path);

    // Whether "page size" has been taken from a process yet.
    bool isPageSizeSet() const { return _isPageSizeSet; }
    void setIsPageSizeSet(bool isPageSizeSet) { _isPageSizeSet = isPageSizeSet; }
    const std::string &path() const { return _path; }
    void setPath(std::string path) { _path = std::move(path); }
    // The whole document; its "processes" member is processes().
    const nlohmann::json &data() const { return _data; }
    void setData(nlohmann::json data) { _data = std::move(data); }
    // The process objects, stored inside the document so that appending to
    // them appends to the document.
    const nlohmann::json &processes() const;
    void setProcesses(nlohmann::json processes) { _data[kProcessesKey] = std::move(processes); }

    // One object per category, keyed by the category's name, with the six
    // size figures; "dirty" includes the swapped bytes.
    static nlohmann::json JSONForCategories(const VSCategoryTable &categories);

    void printProcessHeader(const VSProcess &process) override;
    void endProcessHeader(const VSProcess &process) override;
    void printProcessTotal(std::uint64_t total, const VSProcess &process) override;
    void printProcessCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &sortedKeys,
                                const VSCategoryTotals &total) override;
    void printProcessAuxData(const VSAuxDataDictionary *auxData) override;
    void printNotes(const std::vector<std::string> &notes) override;
    void printProcessesWithWarnings(const std::vector<const VSProcess *> &processesWithWarnings,
                                    const std::vector<const VSProcess *> &processesWithErrors,
                                    const std::vector<std::string> &globalErrors) override;
    void printSummaryCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &sortedKeys,
                                const VSCategoryTotals &total, bool hadErrors) override;
    void printGlobalAuxData(const VSAuxDataDictionary *auxData) override;
    // Writes the document to path(); on failure prints
    // "Unable to serialize/write JSON data due to error: <reason>".
    void end() override;

private:
    static constexpr const char *kProcessesKey = "processes";

    // The object the current process's calls fill: the last one appended.
    // Null before the first process header.
    nlohmann::json *_currentProcess();

    bool _isPageSizeSet = false;
    std::string _path;
    nlohmann::json _data;
};
