#include "output/openmetrics_formatter.h"

#include <cstdio>

#include "model/utf8.h"
#include "targets/platform/files.h"
#include "targets/process.h"

namespace {

void family(std::string &out, const char *name, const char *help) {
    out += "# TYPE ";
    out += name;
    out += " gauge\n# UNIT ";
    out += name;
    out += " bytes\n# HELP ";
    out += name;
    out += ' ';
    out += help;
    out += '\n';
}

void sample(std::string &out, const char *name, const std::string &labels, std::uint64_t value) {
    out += name;
    if (!labels.empty()) {
        out += '{';
        out += labels;
        out += '}';
    }
    out += ' ';
    out += std::to_string(value);
    out += '\n';
}

} // namespace

VSOutputFormatterOpenMetrics::VSOutputFormatterOpenMetrics(std::string path) : _path(std::move(path)) {}

bool VSOutputFormatterOpenMetrics::implementsOperation(VSOptionalFormatterOperation operation) const {
    return operation == VSOptionalFormatterOperation::printSharedCategories;
}

std::string VSOutputFormatterOpenMetrics::labelValue(const std::string &text) {
    std::string out;
    for (std::size_t i = 0; i < text.size();) {
        std::uint32_t point = 0;
        const std::size_t length = vs::utf8SequenceAt(text, i, point);
        if (length == 0) {
            out += "\xEF\xBF\xBD"; // U+FFFD for a byte that starts no character
            ++i;
            continue;
        }
        const char c = text[i];
        if (length == 1 && (c == '\\' || c == '"')) {
            out += '\\';
            out += c;
        } else if (length == 1 && c == '\n') {
            out += "\\n";
        } else {
            out.append(text, i, length);
        }
        i += length;
    }
    return out;
}

void VSOutputFormatterOpenMetrics::printProcessHeader(const VSProcess &process) {
    _inKernel = process.pid() == 0;
    Process entry;
    entry.labels = "pid=\"" + std::to_string(process.pid()) + "\",name=\"" + labelValue(process.name()) + "\"";
    _processes.push_back(std::move(entry));
}

void VSOutputFormatterOpenMetrics::printProcessTotal(std::uint64_t total, const VSProcess &) {
    _processes.back().vestage = total;
    _processes.back().measured = true;
}

void VSOutputFormatterOpenMetrics::printProcessCategories(const VSCategoryTable &categories,
                                                          const VSSortedCategoryKeys &,
                                                          const VSCategoryTotals &total) {
    _processes.back().privateDirty += total.dirty;
    _processes.back().swapped += total.swapped;
    if (!_inKernel) {
        return;
    }
    for (const auto &[name, category] : categories) {
        _kernel.push_back({name, category.totalDirtySize(), category.totalSwappedSize(), category.totalCleanSize(),
                           category.totalReclaimableSize(), category.totalWiredSize()});
    }
}

void VSOutputFormatterOpenMetrics::printSharedCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                                         const VSProcessGroup &, const VSProcess &,
                                                         const VSCategoryTotals &total) {
    _processes.back().swapped += total.swapped;
}

void VSOutputFormatterOpenMetrics::printSummaryCategories(const VSCategoryTable &, const VSSortedCategoryKeys &,
                                                          const VSCategoryTotals &total, bool hadErrors) {
    _summary = total;
    _hasSummary = true;
    _hadErrors = hadErrors;
}

void VSOutputFormatterOpenMetrics::end() {
    std::string out;
    family(out, "vestage_process_bytes",
           "Vestage of a process: dirty and swapped bytes of every memory object it maps.");
    for (const Process &p : _processes) {
        if (p.measured) {
            sample(out, "vestage_process_bytes", p.labels, p.vestage);
        }
    }
    family(out, "vestage_process_private_dirty_bytes", "Dirty bytes of the memory a process alone maps.");
    for (const Process &p : _processes) {
        if (p.measured) {
            sample(out, "vestage_process_private_dirty_bytes", p.labels, p.privateDirty);
        }
    }
    family(out, "vestage_process_swapped_bytes", "Swapped bytes of the memory objects a process maps.");
    for (const Process &p : _processes) {
        if (p.measured) {
            sample(out, "vestage_process_swapped_bytes", p.labels, p.swapped);
        }
    }
    // Not "summary": scrapers reserve the word for a metric type.
    family(out, "vestage_all_targets_bytes",
           "All targets together, every memory object once: bytes by column (vestage is dirty plus swapped).");
    const std::pair<const char *, std::uint64_t> columns[] = {
        {"vestage", _summary.dirty + _summary.swapped}, {"dirty", _summary.dirty}, {"swapped", _summary.swapped},
        {"clean", _summary.clean}, {"reclaimable", _summary.reclaimable}, {"wired", _summary.wired},
    };
    for (const auto &[column, value] : columns) {
        sample(out, "vestage_all_targets_bytes", std::string("column=\"") + column + "\"", value);
    }
    if (!_kernel.empty()) {
        family(out, "vestage_kernel_bytes", "The kernel's memory by category and column.");
        for (const KernelCategory &k : _kernel) {
            const std::string category = "category=\"" + labelValue(k.name) + "\",column=\"";
            sample(out, "vestage_kernel_bytes", category + "dirty\"", k.dirty);
            sample(out, "vestage_kernel_bytes", category + "clean\"", k.clean);
            sample(out, "vestage_kernel_bytes", category + "reclaimable\"", k.reclaimable);
            sample(out, "vestage_kernel_bytes", category + "wired\"", k.wired);
        }
    }
    out += "# TYPE vestage_report_complete gauge\n"
           "# HELP vestage_report_complete 1 when every target was read without errors, else 0.\n";
    out += "vestage_report_complete ";
    out += _hadErrors ? "0\n" : "1\n";
    out += "# EOF\n";
    if (_path == "-") {
        std::fwrite(out.data(), 1, out.size(), stdout);
        return;
    }
    if (std::optional<vs::FileFailure> failure = vs::writeOutputFile(_path, out, 0644)) {
        std::fprintf(stderr, "Unable to write the OpenMetrics file: %s\n", failure->reason.c_str());
    }
}
