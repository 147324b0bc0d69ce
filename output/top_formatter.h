#pragma once

// The answer on one screen: one line per process, largest vestage first,
// with what it owns and what it shares (dirty and swapped, as the report's
// Dirty column: together its vestage), the swapped part, and how many
// processes it shares with; then the summary's total.

#include <cstdint>
#include <cstdio>
#include <set>
#include <string>
#include <vector>

#include "output/output_formatter.h"
#include "output/text_formatter.h"

class VSOutputFormatterTop final : public VSOutputFormatter {
public:
    // At most `lines` processes; sizes in the text report's -f format.
    VSOutputFormatterTop(std::size_t lines, std::int64_t summaryFormat, std::FILE *output = stdout);

    bool implementsOperation(VSOptionalFormatterOperation operation) const override;
    void printProcessHeader(const VSProcess &process) override;
    void endProcessHeader(const VSProcess &) override {}
    void printProcessTotal(std::uint64_t total, const VSProcess &process) override;
    void printProcessCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                const VSCategoryTotals &total) override;
    void printProcessAuxData(const VSAuxDataDictionary *) override {}
    void printProcessesWithWarnings(const std::vector<const VSProcess *> &, const std::vector<const VSProcess *> &,
                                    const std::vector<std::string> &) override {}
    void printSummaryCategories(const VSCategoryTable &, const VSSortedCategoryKeys &, const VSCategoryTotals &total,
                                bool hadErrors) override;
    void printGlobalAuxData(const VSAuxDataDictionary *) override {}
    void printSharedCategories(const VSCategoryTable &, const VSSortedCategoryKeys &, const VSProcessGroup &sharedWith,
                               const VSProcess &process, const VSCategoryTotals &total) override;
    void end() override;

private:
    struct Row {
        std::int32_t pid = 0;
        std::string name;
        std::uint64_t pageSize = 0;
        bool measured = false; // false: the process could not be read
        std::uint64_t vestage = 0, own = 0, shared = 0, swapped = 0;
        std::set<std::int32_t> sharers;
    };

    std::size_t _lines;
    std::FILE *_output;
    VSOutputFormatterText _sizes;
    std::vector<Row> _rows;
    std::uint64_t _summary = 0;
    bool _hadErrors = false;
};
