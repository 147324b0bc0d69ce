#pragma once

// The text report on standard output. Every size goes through
// formattedStringForSize(), so the -f format decides how all figures read;
// in the pages format they count pages of the process whose header was
// printed last (the summary too, which therefore uses the last process's
// page size).

#include <array>
#include <cstdint>
#include <cstdio>
#include <string>

#include "output/output_formatter.h"
#include "output/output_options.h"

class VSOutputFormatterText final : public VSOutputFormatter {
public:
    // summaryFormat is one of VSSummaryFormat*, options a set of
    // VSOutputOption* bits. Writes to standard output until setOutput().
    VSOutputFormatterText(std::int64_t summaryFormat, std::int64_t options);

    // The text of one size: "16384 B", "16 KB" or "4 pages".
    std::string formattedStringForSize(std::uint64_t size) const;

    std::int64_t summaryFormat() const { return _summaryFormat; }
    void setSummaryFormat(std::int64_t summaryFormat) { _summaryFormat = summaryFormat; }
    std::int64_t options() const { return _options; }
    void setOptions(std::int64_t options) { _options = options; }
    // Not owned; the caller keeps the stream open until end().
    std::FILE *output() const { return _output; }
    void setOutput(std::FILE *output) { _output = output; }
    // Page size of the pages format; set by every process header.
    std::uint64_t pageSize() const { return _pageSize; }
    void setPageSize(std::uint64_t pageSize) { _pageSize = pageSize; }

    bool implementsOperation(VSOptionalFormatterOperation operation) const override;

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
    // Flushes the output; prints nothing.
    void end() override;

    void printSpanlistLikeOutputForProcess(const VSProcess &process,
                                           const std::vector<const VSMemoryRegion *> &regions) override;
    void printSharedCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &sortedKeys,
                               const VSProcessGroup &sharedWith, const VSProcess &process,
                               const VSCategoryTotals &total) override;

private:
    struct ColumnWidths {
        int dirty;
        int swapped; // 0 when the column is not shown
        int clean;
        int reclaimable;
        int wired; // 0 when the column is not shown
    };

    bool _showsSwapped() const { return (_options & VSOutputOptionSwapped) != 0; }
    bool _showsWired() const { return (_options & VSOutputOptionWired) != 0; }
    ColumnWidths _columnWidths() const;
    // formattedStringForSize into a buffer of the caller's; returns it.
    const char *_formatSize(std::uint64_t size, char (&buffer)[32]) const;

    // The "=" rule; closing adds an empty line after it.
    void _printRule(bool closing);
    void _printTableHeader();
    void _printSeparatorRow();
    // One table line: the five figure columns right-aligned in their
    // widths, the region count in 10, then the category.
    void _putRow(const char *dirty, const char *swapped, const char *clean, const char *reclaimable,
                 const char *wired, const char *regions, const char *label);
    void _printRow(std::uint64_t dirtyAndSwapped, std::uint64_t swapped, std::uint64_t clean,
                   std::uint64_t reclaimable, std::uint64_t wired, std::int64_t regions, const char *label);
    void _printCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &sortedKeys);
    void _printTotalFooter(const VSCategoryTotals &total);
    void _printTable(const VSCategoryTable &categories, const VSSortedCategoryKeys &sortedKeys,
                     const VSCategoryTotals &total);
    void printAuxData(const VSAuxDataDictionary &auxData);
    void _printAuxData(const VSAuxDataDictionary &auxData, std::uint32_t indent);
    void _printPhysVestageBreakdownEnabled();

    // Humanized sizes already worked out: a report repeats a few figures
    // (0 B, a page, ...) in most of its rows, and each text takes the
    // library a thousand instructions and more.
    struct SizeText {
        std::uint64_t size = 0;
        bool known = false;
        char text[8] = {};
    };
    mutable std::array<SizeText, 256> _sizeTexts{};
    // Table lines are put together here and written in one piece: a report
    // has a row per category per table, and parsing a printf format for
    // each was a third of the report's cost.
    std::string _line;

    std::int32_t _processCount = 0;
    std::uint64_t _pageSize = 0;
    std::int64_t _summaryFormat;
    std::int64_t _options;
    std::FILE *_output;
};
