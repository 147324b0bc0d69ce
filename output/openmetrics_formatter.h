#pragma once

// The report's figures in the OpenMetrics text format, for scrapers and
// node exporters' textfile directories: per process its vestage, private
// dirty and swapped bytes; the summary's totals; the kernel's categories.
// Written whole at the end, to a file (replaced atomically, as the JSON
// document) or to standard output ("-").

#include <cstdint>
#include <string>
#include <vector>

#include "output/output_formatter.h"

class VSOutputFormatterOpenMetrics final : public VSOutputFormatter {
public:
    explicit VSOutputFormatterOpenMetrics(std::string path);

    bool implementsOperation(VSOptionalFormatterOperation operation) const override;
    void printProcessHeader(const VSProcess &process) override;
    void endProcessHeader(const VSProcess &) override {}
    void printProcessTotal(std::uint64_t total, const VSProcess &process) override;
    void printProcessCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &,
                                const VSCategoryTotals &total) override;
    void printProcessAuxData(const VSAuxDataDictionary *) override {}
    void printProcessesWithWarnings(const std::vector<const VSProcess *> &, const std::vector<const VSProcess *> &,
                                    const std::vector<std::string> &) override {}
    void printSummaryCategories(const VSCategoryTable &, const VSSortedCategoryKeys &, const VSCategoryTotals &total,
                                bool hadErrors) override;
    void printGlobalAuxData(const VSAuxDataDictionary *) override {}
    void printSharedCategories(const VSCategoryTable &, const VSSortedCategoryKeys &, const VSProcessGroup &,
                               const VSProcess &, const VSCategoryTotals &total) override;
    void end() override;

    // A label value as the format wants it: backslash, double quote and
    // line feed escaped, bytes that are not UTF-8 replaced by U+FFFD.
    static std::string labelValue(const std::string &text);

private:
    struct Process {
        std::string labels;
        bool measured = false;
        std::uint64_t vestage = 0, privateDirty = 0, swapped = 0;
    };
    struct KernelCategory {
        std::string name;
        std::uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0, wired = 0;
    };

    std::string _path;
    std::vector<Process> _processes;
    std::vector<KernelCategory> _kernel;
    bool _inKernel = false;
    VSCategoryTotals _summary{};
    bool _hasSummary = false;
    bool _hadErrors = false;
};
