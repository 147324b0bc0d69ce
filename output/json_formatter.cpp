#include "output/json_formatter.h"

#include <cstdio>
#include <exception>
#include <optional>

#include "analysis/vestage.h"
#include "model/aux_data.h"
#include "targets/platform/files.h"
#include "targets/platform/platform.h"
#include "targets/process.h"

namespace {

// The six figures of one category, or of the totals under "summary".
nlohmann::json sizesObject(std::uint64_t dirtyAndSwapped, std::uint64_t swapped, std::uint64_t clean,
                           std::uint64_t reclaimable, std::uint64_t wired, std::int64_t regions) {
    nlohmann::json sizes = nlohmann::json::object();
    sizes["dirty"] = dirtyAndSwapped;
    sizes["swapped"] = swapped;
    sizes["clean"] = clean;
    sizes["reclaimable"] = reclaimable;
    sizes["wired"] = wired;
    sizes["regions"] = regions;
    return sizes;
}

void reportWriteFailure(const std::string &reason) {
    std::fprintf(stderr, "Unable to serialize/write JSON data due to error: %s\n", reason.c_str());
}

} // namespace

VSOutputFormatterJSON::VSOutputFormatterJSON(std::string path) : _path(std::move(path)) {
    _data = nlohmann::json::object();
    _data["total vestage"] = 0;
    _data["summary"] = nlohmann::json::object();
    _data[kProcessesKey] = nlohmann::json::array();
    _data["auxiliary"] = nlohmann::json::object();
    _data["unit"] = "byte";
    _data["bytes per unit"] = 1;
    _data["page size"] = VSPlatform::current().kernel_page_size();
    _data["errors"] = nlohmann::json::array();
    _data["warnings"] = nlohmann::json::array();
    // Present only when on: readers test for the key, never for false.
    if (VSVestage::breakDownPhysVestage()) {
        _data["phys_vestage_breakdown"] = true;
    }
}

const nlohmann::json &VSOutputFormatterJSON::processes() const {
    static const nlohmann::json none = nlohmann::json::array();
    auto found = _data.find(kProcessesKey);
    return found == _data.end() ? none : *found;
}

nlohmann::json *VSOutputFormatterJSON::_currentProcess() {
    auto found = _data.find(kProcessesKey);
    if (found == _data.end() || !found->is_array() || found->empty()) {
        return nullptr;
    }
    return &found->back();
}

nlohmann::json VSOutputFormatterJSON::JSONForCategories(const VSCategoryTable &categories) {
    nlohmann::json map = nlohmann::json::object();
    for (const auto &entry : categories) {
        const VSMemoryCategory &category = entry.second;
        map[category.name()] = sizesObject(category.totalDirtySize() + category.totalSwappedSize(),
                                           category.totalSwappedSize(), category.totalCleanSize(),
                                           category.totalReclaimableSize(), category.totalWiredSize(),
                                           category.totalRegions());
    }
    return map;
}

void VSOutputFormatterJSON::printProcessHeader(const VSProcess &process) {
    nlohmann::json object = nlohmann::json::object();
    object["name"] = process.name();
    object["pid"] = process.pid();
    object["vestage"] = 0;
    object["categories"] = nlohmann::json::object();
    object["auxiliary"] = nlohmann::json::object();
    const std::vector<std::string> errors = process.errors();
    if (!errors.empty()) {
        object["errors"] = errors;
    }
    if (!process.warnings().empty()) {
        object["warnings"] = process.warnings();
    }
    _data[kProcessesKey].push_back(std::move(object));

    // The first process listed is the one with the largest vestage; its
    // page size stands for the whole document.
    if (!_isPageSizeSet) {
        _data["page size"] = process.pageSize();
        _isPageSizeSet = true;
    }
}

void VSOutputFormatterJSON::endProcessHeader(const VSProcess &) {}

void VSOutputFormatterJSON::printProcessTotal(std::uint64_t total, const VSProcess &) {
    if (nlohmann::json *process = _currentProcess()) {
        (*process)["vestage"] = total;
    }
}

void VSOutputFormatterJSON::printProcessCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &,
                                                   const VSCategoryTotals &) {
    if (nlohmann::json *process = _currentProcess()) {
        (*process)["categories"] = JSONForCategories(categories);
    }
}

void VSOutputFormatterJSON::printProcessAuxData(const VSAuxDataDictionary *auxData) {
    nlohmann::json *process = _currentProcess();
    if (process == nullptr) {
        return;
    }
    if (auxData != nullptr) {
        (*process)["auxiliary"] = auxData->jsonRepresentation();
    } else {
        process->erase("auxiliary");
    }
}

void VSOutputFormatterJSON::printProcessesWithWarnings(const std::vector<const VSProcess *> &processesWithWarnings,
                                                       const std::vector<const VSProcess *> &processesWithErrors,
                                                       const std::vector<std::string> &globalErrors) {
    nlohmann::json errors = nlohmann::json::array();
    for (const std::string &error : globalErrors) {
        errors.push_back(error);
    }
    for (const VSProcess *process : processesWithErrors) {
        for (const std::string &error : process->errors()) {
            errors.push_back(error);
        }
    }
    nlohmann::json warnings = nlohmann::json::array();
    for (const VSProcess *process : processesWithWarnings) {
        for (const std::string &warning : process->warnings()) {
            warnings.push_back(warning);
        }
    }
    _data["errors"] = std::move(errors);
    _data["warnings"] = std::move(warnings);
}

void VSOutputFormatterJSON::printNotes(const std::vector<std::string> &notes) {
    if (!notes.empty()) {
        _data["notes"] = notes;
    }
}

void VSOutputFormatterJSON::printSummaryCategories(const VSCategoryTable &categories, const VSSortedCategoryKeys &,
                                                   const VSCategoryTotals &total, bool) {
    nlohmann::json summary = JSONForCategories(categories);
    // Added after the categories, so it wins over a category named "total".
    summary["total"] = sizesObject(total.dirty + total.swapped, total.swapped, total.clean, total.reclaimable,
                                   total.wired, total.regions);
    _data["summary"] = std::move(summary);
    _data["total vestage"] = total.dirty + total.swapped;
}

void VSOutputFormatterJSON::printGlobalAuxData(const VSAuxDataDictionary *auxData) {
    if (auxData != nullptr) {
        _data["auxiliary"] = auxData->jsonRepresentation();
    } else {
        _data.erase("auxiliary");
    }
}

void VSOutputFormatterJSON::end() {
    std::string document;
    try {
        // Names come from the system and need not be valid UTF-8; a name
        // with a stray byte should not cost the whole document, so such
        // bytes become U+FFFD instead of failing the serialisation.
        document = _data.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
    } catch (const std::exception &exception) {
        reportWriteFailure(exception.what());
        return;
    }
    if (_path == "-") {
        // The document is the report: a failed write is the run's to see.
        document += '\n';
        std::fwrite(document.data(), 1, document.size(), stdout);
        return;
    }
    try {
        if (std::optional<vs::FileFailure> failure = vs::writeOutputFile(_path, document, 0644)) {
            reportWriteFailure(failure->reason);
        }
    } catch (const std::exception &exception) {
        // Only an exhausted memory gets here; the run still ends normally.
        reportWriteFailure(exception.what());
    }
}
