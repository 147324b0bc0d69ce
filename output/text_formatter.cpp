#include "output/text_formatter.h"

#include <bsd/libutil.h>

#include <algorithm>
#include <charconv>
#include <cstring>

#include "analysis/vestage.h"
#include "model/assert.h"
#include "model/aux_data.h"
#include "model/memory_region.h"
#include "output/visible_text.h"
#include "targets/process.h"

namespace {

constexpr const char *kRulePiece = "==========";
constexpr const char *kSeparator = "---";

// Appends `text` right-aligned in `width` columns (wider text as it is).
void padLeft(std::string &line, int width, const char *text) {
    const std::size_t length = std::strlen(text);
    if (length < static_cast<std::size_t>(std::max(width, 0))) {
        line.append(static_cast<std::size_t>(width) - length, ' ');
    }
    line.append(text, length);
}

// `text` as the terminal should see it (names come from other users);
// `scratch` holds an escaped copy while the result is in use.
const char *shown(const std::string &text, std::string &scratch) {
    if (vs::isVisibleText(text)) {
        return text.c_str();
    }
    scratch = vs::visibleText(text);
    return scratch.c_str();
}

std::uint64_t pagesOf(std::uint64_t bytes, std::uint64_t pageSize) {
    return pageSize == 0 ? 0 : (bytes + pageSize - 1) / pageSize;
}

} // namespace

VSOutputFormatterText::VSOutputFormatterText(std::int64_t summaryFormat, std::int64_t options)
    : _summaryFormat(summaryFormat), _options(options), _output(stdout) {}

const char *VSOutputFormatterText::_formatSize(std::uint64_t size, char (&buffer)[32]) const {
    switch (_summaryFormat) {
    case VSSummaryFormatFormatted: {
        SizeText &known = _sizeTexts[(size ^ (size >> 12) ^ (size >> 24)) % _sizeTexts.size()];
        if (!known.known || known.size != size) {
            // Eight bytes leave room for at most four digits before the prefix.
            known.text[0] = '\0';
            humanize_number(known.text, sizeof known.text, static_cast<std::int64_t>(size), "B", HN_AUTOSCALE, 0);
            known.size = size;
            known.known = true;
        }
        std::memcpy(buffer, known.text, sizeof known.text);
        break;
    }
    case VSSummaryFormatPages:
        std::snprintf(buffer, sizeof buffer, "%llu pages", static_cast<unsigned long long>(pagesOf(size, _pageSize)));
        break;
    default:
        std::snprintf(buffer, sizeof buffer, "%lld B", static_cast<long long>(size));
        break;
    }
    return buffer;
}

std::string VSOutputFormatterText::formattedStringForSize(std::uint64_t size) const {
    char buffer[32];
    return _formatSize(size, buffer);
}

bool VSOutputFormatterText::implementsOperation(VSOptionalFormatterOperation) const { return true; }

VSOutputFormatterText::ColumnWidths VSOutputFormatterText::_columnWidths() const {
    const bool narrow = _summaryFormat == VSSummaryFormatFormatted;
    ColumnWidths widths{};
    widths.dirty = narrow ? 7 : 11;
    widths.swapped = _showsSwapped() ? (narrow ? 11 : 14) : 0;
    widths.clean = narrow ? 11 : 14;
    widths.reclaimable = narrow ? 13 : 14;
    widths.wired = _showsWired() ? (narrow ? 11 : 14) : 0;
    return widths;
}

void VSOutputFormatterText::_printRule(bool closing) {
    const char *swapped = _showsSwapped() ? kRulePiece : "";
    const char *wired = _showsWired() ? kRulePiece : "";
    const int swappedWidth = _showsSwapped() ? 10 : 0;
    const int wiredWidth = _showsWired() ? 10 : 0;
    if (closing) {
        std::fprintf(_output, "%s%s%s%*s%s%s%*s%s%s\n\n", kRulePiece, kRulePiece, kRulePiece, swappedWidth,
                     swapped, kRulePiece, kRulePiece, wiredWidth, wired, kRulePiece, kRulePiece);
    } else {
        std::fprintf(_output, "%s%s%s%*s%s%s%*s%s%s\n", kRulePiece, kRulePiece, kRulePiece, swappedWidth,
                     swapped, kRulePiece, kRulePiece, wiredWidth, wired, kRulePiece, kRulePiece);
    }
}

void VSOutputFormatterText::_putRow(const char *dirty, const char *swapped, const char *clean,
                                    const char *reclaimable, const char *wired, const char *regions,
                                    const char *label) {
    const ColumnWidths w = _columnWidths();
    _line.clear();
    padLeft(_line, w.dirty, dirty);
    padLeft(_line, w.swapped, swapped);
    padLeft(_line, w.clean, clean);
    padLeft(_line, w.reclaimable, reclaimable);
    padLeft(_line, w.wired, wired);
    _line.push_back(' ');
    padLeft(_line, 10, regions);
    _line.append("    ");
    _line.append(label);
    _line.push_back('\n');
    std::fwrite(_line.data(), 1, _line.size(), _output);
}

void VSOutputFormatterText::_printTableHeader() {
    _putRow("Dirty", _showsSwapped() ? "(Swapped)" : "", "Clean", "Reclaimable", _showsWired() ? "(Wired)" : "",
            "Regions", "Category");
}

void VSOutputFormatterText::_printSeparatorRow() {
    _putRow(kSeparator, _showsSwapped() ? kSeparator : "", kSeparator, kSeparator, _showsWired() ? kSeparator : "",
            kSeparator, kSeparator);
}

void VSOutputFormatterText::_printRow(std::uint64_t dirtyAndSwapped, std::uint64_t swapped, std::uint64_t clean,
                                      std::uint64_t reclaimable, std::uint64_t wired, std::int64_t regions,
                                      const char *label) {
    char dirtyText[32], swappedText[32] = "", cleanText[32], reclaimableText[32], wiredText[32] = "";
    if (_showsSwapped()) {
        _formatSize(swapped, swappedText);
    }
    if (_showsWired()) {
        _formatSize(wired, wiredText);
    }
    char regionsText[16];
    *std::to_chars(regionsText, regionsText + sizeof regionsText - 1, static_cast<int>(regions)).ptr = '\0';
    _putRow(_formatSize(dirtyAndSwapped, dirtyText), swappedText, _formatSize(clean, cleanText),
            _formatSize(reclaimable, reclaimableText), wiredText, regionsText, label);
}

void VSOutputFormatterText::_printCategories(const VSCategoryTable &categories,
                                             const VSSortedCategoryKeys &sortedKeys) {
    for (const std::string &key : sortedKeys) {
        auto found = categories.find(key);
        VS_ASSERT(found != categories.end());
        const VSMemoryCategory &category = found->second;
        std::string scratch;
        _printRow(category.totalDirtySize() + category.totalSwappedSize(), category.totalSwappedSize(),
                  category.totalCleanSize(), category.totalReclaimableSize(), category.totalWiredSize(),
                  category.totalRegions(), shown(key, scratch));
    }
}

void VSOutputFormatterText::_printTotalFooter(const VSCategoryTotals &total) {
    _printSeparatorRow();
    _printRow(total.dirty + total.swapped, total.swapped, total.clean, total.reclaimable, total.wired,
              static_cast<std::int32_t>(total.regions), "TOTAL");
}

void VSOutputFormatterText::_printTable(const VSCategoryTable &categories, const VSSortedCategoryKeys &sortedKeys,
                                        const VSCategoryTotals &total) {
    _printTableHeader();
    _printSeparatorRow();
    _printCategories(categories, sortedKeys);
    _printTotalFooter(total);
}

void VSOutputFormatterText::printProcessHeader(const VSProcess &process) {
    ++_processCount;
    _pageSize = process.pageSize();
    _printRule(false);
    std::string scratch;
    std::fprintf(_output, "%s: %s-bit", shown(process.displayString(), scratch), process.is64bit() ? "64" : "32");
    const auto &warnings = process.warnings();
    if (!warnings.empty()) {
        std::fputs("\nWarnings were encountered while examining the process.\n", _output);
        for (const std::string &warning : warnings) {
            std::fprintf(_output, "\t%s\n", shown(warning, scratch));
        }
    }
    const auto errors = process.errors();
    if (!errors.empty()) {
        std::fputs("\nErrors were encountered while examining the process. No results gathered.\n", _output);
        for (const std::string &error : errors) {
            std::fprintf(_output, "\t%s\n", shown(error, scratch));
        }
    }
}

void VSOutputFormatterText::printProcessTotal(std::uint64_t total, const VSProcess &process) {
    std::fprintf(_output, "\tVestage: %s (%lu bytes per page)\n", formattedStringForSize(total).c_str(),
                 static_cast<unsigned long>(process.pageSize()));
}

void VSOutputFormatterText::endProcessHeader(const VSProcess &) { _printRule(true); }

void VSOutputFormatterText::printProcessCategories(const VSCategoryTable &categories,
                                                   const VSSortedCategoryKeys &sortedKeys,
                                                   const VSCategoryTotals &total) {
    _printTable(categories, sortedKeys, total);
    std::fputs("\n", _output);
}

void VSOutputFormatterText::printSharedCategories(const VSCategoryTable &categories,
                                                  const VSSortedCategoryKeys &sortedKeys,
                                                  const VSProcessGroup &sharedWith, const VSProcess &process,
                                                  const VSCategoryTotals &total) {
    // The group counts the process itself; long lists give just the number.
    const std::size_t members = sharedWith.size();
    if (members >= 21) {
        std::fprintf(_output, "Shared with %lu processes:\n", static_cast<unsigned long>(members));
    } else {
        std::fputs("Shared with", _output);
        std::size_t printed = 0;
        for (const VSProcess *other : sharedWith) {
            if (other->pid() == process.pid()) {
                continue;
            }
            std::string scratch;
            std::fprintf(_output, " %s", shown(other->displayString(), scratch));
            ++printed;
            if (members - 1 > printed) {
                std::fputs(",", _output);
            }
        }
        std::fputs(":\n", _output);
    }
    _printTable(categories, sortedKeys, total);
    std::fputs("\n", _output);
}

void VSOutputFormatterText::printProcessAuxData(const VSAuxDataDictionary *auxData) {
    if (auxData == nullptr) {
        return;
    }
    printAuxData(*auxData);
    std::fputs("\n", _output);
}

void VSOutputFormatterText::printProcessesWithWarnings(const std::vector<const VSProcess *> &processesWithWarnings,
                                                       const std::vector<const VSProcess *> &processesWithErrors,
                                                       const std::vector<std::string> &globalErrors) {
    if (!processesWithWarnings.empty()) {
        std::fputs("\nWarnings were encountered while examining the following processes:\n", _output);
        for (const VSProcess *process : processesWithWarnings) {
            std::string scratch;
            std::fprintf(_output, "\t%s\n", shown(process->name(), scratch));
        }
    }
    if (!processesWithErrors.empty()) {
        std::fputs("\nErrors were encountered while examining the following processes:\n", _output);
        for (const VSProcess *process : processesWithErrors) {
            std::string scratch;
            std::fprintf(_output, "\t%s\n", shown(process->name(), scratch));
        }
    }
    if (!globalErrors.empty()) {
        std::fputs("\nErrors were encountered:\n", _output);
        for (const std::string &error : globalErrors) {
            std::string scratch;
            std::fprintf(_output, "\t%s\n", shown(error, scratch));
        }
    }
    if (!processesWithErrors.empty() || !globalErrors.empty()) {
        std::fputs("\nDue to errors, summary results may be invalid\n", _output);
    }
}

void VSOutputFormatterText::printNotes(const std::vector<std::string> &notes) {
    if (notes.empty()) {
        return;
    }
    std::fputs("\nNotes:\n", _output);
    for (const std::string &note : notes) {
        std::string scratch;
        std::fprintf(_output, "\t%s\n", shown(note, scratch));
    }
}

void VSOutputFormatterText::_printPhysVestageBreakdownEnabled() {
    // Standard output itself, not `output`.
    if (VSVestage::breakDownPhysVestage()) {
        std::fputs("Physical Vestage Breakdown: Enabled\n", stdout);
    }
}

void VSOutputFormatterText::printSummaryCategories(const VSCategoryTable &categories,
                                                   const VSSortedCategoryKeys &sortedKeys,
                                                   const VSCategoryTotals &total, bool hadErrors) {
    _printPhysVestageBreakdownEnabled();
    // A report about a single process has nothing to sum up.
    if (_processCount == 1) {
        return;
    }
    _printRule(false);
    std::fprintf(_output, "Summary Vestage: %s%s\n", formattedStringForSize(total.dirty + total.swapped).c_str(),
                 hadErrors ? " (may be invalid due to errors)" : "");
    _printRule(true);
    _printTable(categories, sortedKeys, total);
}

void VSOutputFormatterText::printGlobalAuxData(const VSAuxDataDictionary *auxData) {
    if (_processCount == 1) {
        return;
    }
    std::fputs("\n", _output);
    if (auxData != nullptr) {
        printAuxData(*auxData);
        std::fputs("\n", _output);
    }
}

void VSOutputFormatterText::printAuxData(const VSAuxDataDictionary &auxData) {
    std::fputs("Auxiliary data:\n", _output);
    _printAuxData(auxData, 1);
}

void VSOutputFormatterText::_printAuxData(const VSAuxDataDictionary &auxData, std::uint32_t indent) {
    for (const auto &[key, node] : auxData.entries()) {
        for (std::uint32_t i = 0; i < indent; ++i) {
            std::fputc('\t', _output);
        }
        if (node->isContainer()) {
            std::fprintf(_output, "%s:\n", key.c_str());
            _printAuxData(static_cast<const VSAuxDataDictionary &>(*node), indent + 1);
        } else {
            const auto &leaf = static_cast<const VSAuxData &>(*node);
            std::fprintf(_output, "%s: %s\n", key.c_str(),
                         formattedStringForSize(static_cast<std::uint64_t>(leaf.value())).c_str());
        }
    }
}

void VSOutputFormatterText::end() { std::fflush(_output); }

void VSOutputFormatterText::printSpanlistLikeOutputForProcess(const VSProcess &process,
                                                              const std::vector<const VSMemoryRegion *> &regions) {
    // Every figure is a page count of the listed process's own pages.
    const std::uint64_t pageSize = process.pageSize();
    const bool swapped = _showsSwapped();
    const bool wired = _showsWired();
    std::string scratch;
    std::fprintf(_output, "%s\n\n", shown(process.displayString(), scratch));
    std::fprintf(_output,
                 "           start                end  [objectid]      VRT     DRT%*s     CLN     RCL%*s   tag "
                 "(detail)\n",
                 swapped ? 8 : 0, swapped ? "     SWP" : "", wired ? 8 : 0, wired ? "    WIRE" : "");
    std::fprintf(_output,
                 "      ----------         ----------  ----------    -----   -----%*s   -----   -----%*s   "
                 "------------\n",
                 swapped ? 8 : 0, swapped ? "   -----" : "", wired ? 8 : 0, wired ? "   -----" : "");
    for (const VSMemoryRegion *region : regions) {
        std::fprintf(_output, "%16llx - %16llx [%10llx]", static_cast<unsigned long long>(region->start()),
                     static_cast<unsigned long long>(region->end()),
                     static_cast<unsigned long long>(region->object_id() & 0xffffffffffULL));
        std::fprintf(_output, " %7llu %7llu", static_cast<unsigned long long>(pagesOf(region->size(), pageSize)),
                     static_cast<unsigned long long>(
                         pagesOf(region->dirtySize() + region->swappedSize(), pageSize)));
        if (swapped) {
            std::fprintf(_output, " %7llu",
                         static_cast<unsigned long long>(pagesOf(region->swappedSize(), pageSize)));
        }
        std::fprintf(_output, " %7llu %7llu",
                     static_cast<unsigned long long>(pagesOf(region->cleanNonSpecSize(), pageSize)),
                     static_cast<unsigned long long>(pagesOf(region->reclaimableSize(), pageSize)));
        if (wired) {
            std::fprintf(_output, " %7llu", static_cast<unsigned long long>(pagesOf(region->wiredSize(), pageSize)));
        }
        const std::string *name = region->sharedName();
        const std::string *detailedName = region->sharedDetailedName();
        std::string detailScratch;
        std::fprintf(_output, "   %s %s\n", name ? shown(*name, scratch) : "",
                     detailedName ? shown(*detailedName, detailScratch) : "");
    }
    std::fputs("\n", _output);
}
