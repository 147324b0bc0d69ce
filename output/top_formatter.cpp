#include "output/top_formatter.h"

#include <algorithm>

#include "output/visible_text.h"
#include "targets/process.h"

VSOutputFormatterTop::VSOutputFormatterTop(std::size_t lines, std::int64_t summaryFormat, std::FILE *output)
    : _lines(lines), _output(output), _sizes(summaryFormat, 0) {}

bool VSOutputFormatterTop::implementsOperation(VSOptionalFormatterOperation operation) const {
    return operation == VSOptionalFormatterOperation::printSharedCategories;
}

void VSOutputFormatterTop::printProcessHeader(const VSProcess &process) {
    Row row;
    row.pid = process.pid();
    row.name = process.name();
    row.pageSize = process.pageSize();
    _rows.push_back(std::move(row));
}

void VSOutputFormatterTop::printProcessTotal(std::uint64_t total, const VSProcess &) {
    _rows.back().vestage = total;
    _rows.back().measured = true;
}

void VSOutputFormatterTop::printProcessCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                                  const VSCategoryTotals &total) {
    _rows.back().own += total.dirty + total.swapped; // as the report's Dirty column
    _rows.back().swapped += total.swapped;
}

void VSOutputFormatterTop::printSharedCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                                 const VSProcessGroup &sharedWith, const VSProcess &process,
                                                 const VSCategoryTotals &total) {
    Row &row = _rows.back();
    row.shared += total.dirty + total.swapped;
    row.swapped += total.swapped;
    for (const VSProcess *member : sharedWith) {
        if (member != &process) {
            row.sharers.insert(member->pid());
        }
    }
}

void VSOutputFormatterTop::printSummaryCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                                  const VSCategoryTotals &total, bool hadErrors) {
    _summary = total.dirty + total.swapped;
    _hadErrors = hadErrors;
}

void VSOutputFormatterTop::end() {
    // The report comes largest vestage first already; processes that could
    // not be read have nothing to rank and are left out.
    std::vector<const Row *> shown;
    std::size_t measured = 0;
    for (const Row &row : _rows) {
        if (row.measured) {
            ++measured;
            if (shown.size() < _lines) {
                shown.push_back(&row);
            }
        }
    }
    std::fprintf(_output, "%7s %-22s %9s %9s %9s %9s %6s\n", "PID", "NAME", "VESTAGE", "OWN", "SHARED", "SWAPPED",
                 "SHARES");
    for (const Row *row : shown) {
        _sizes.setPageSize(row->pageSize);
        std::string name = vs::visibleText(row->name);
        if (name.size() > 22) {
            name = name.substr(0, 21) + "~";
        }
        std::fprintf(_output, "%7d %-22s %9s %9s %9s %9s %6zu\n", row->pid, name.c_str(),
                     _sizes.formattedStringForSize(row->vestage).c_str(),
                     _sizes.formattedStringForSize(row->own).c_str(),
                     _sizes.formattedStringForSize(row->shared).c_str(),
                     _sizes.formattedStringForSize(row->swapped).c_str(), row->sharers.size());
    }
    const std::string total = "TOTAL, " + std::to_string(measured) + (measured == 1 ? " process" : " processes");
    std::fprintf(_output, "%7s %-22s %9s%s\n", "", total.c_str(), _sizes.formattedStringForSize(_summary).c_str(),
                 _hadErrors ? "  (may be invalid due to errors)" : "");
    std::fflush(_output);
}
