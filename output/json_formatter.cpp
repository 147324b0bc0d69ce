#include "output/json_formatter.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <filesystem>
#include <optional>
#include <random>

#include "analysis/vestage.h"
#include "model/aux_data.h"
#include "targets/platform/platform.h"
#include "targets/process.h"

namespace {

namespace fs = std::filesystem;

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

// errno as left by a failed stdio call; stdio may leave it unset on a short
// write, and the report must still name some reason.
int lastError() { return errno != 0 ? errno : EIO; }

// Writes all of contents and closes the stream. Returns the error, if any;
// the stream is closed either way.
std::optional<int> writeAndClose(std::FILE *stream, const std::string &contents) {
    errno = 0;
    const std::size_t written = std::fwrite(contents.data(), 1, contents.size(), stream);
    std::optional<int> error;
    if (written != contents.size() || std::fflush(stream) != 0) {
        error = lastError();
    }
    // Closing reports what the final flush met (a full disk, a quota).
    errno = 0;
    if (std::fclose(stream) != 0 && !error) {
        error = lastError();
    }
    return error;
}

std::optional<int> writeInPlace(const fs::path &file, const std::string &contents) {
    errno = 0;
    std::FILE *stream = std::fopen(file.c_str(), "w");
    if (stream == nullptr) {
        return lastError();
    }
    return writeAndClose(stream, contents);
}

std::string randomSuffix() {
    std::uint64_t seed = 0;
    try {
        seed = (static_cast<std::uint64_t>(std::random_device{}()) << 32) ^ std::random_device{}();
    } catch (const std::exception &) {
        // Without an entropy source the exclusive create still keeps names
        // apart; it only takes more attempts.
        seed = static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(&seed));
    }
    static thread_local std::mt19937_64 generator(seed);
    char text[17];
    std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(generator()));
    return text;
}

// Replaces file with a new one holding contents, through a temporary file
// in the same directory (so that the rename stays on one file system and is
// atomic). The temporary file never survives a failure.
std::optional<int> replaceFile(const fs::path &file, const std::string &contents) {
    std::error_code ignored;
    const fs::file_status existing = fs::status(file, ignored);
    const bool exists = fs::is_regular_file(existing);
    if (exists) {
        // Renaming over a file needs only a writable directory; keep the
        // file's own protection meaningful by asking for write access first
        // (append mode neither truncates nor changes the file).
        errno = 0;
        std::FILE *probe = std::fopen(file.c_str(), "a");
        if (probe == nullptr) {
            return lastError();
        }
        std::fclose(probe);
    }

    const fs::path directory = file.has_parent_path() ? file.parent_path() : fs::path(".");
    // Hidden, and short enough to stay within the name limit whatever the
    // target is called.
    const std::string stem = "." + file.filename().string().substr(0, 200) + ".";
    fs::path temporary;
    std::FILE *stream = nullptr;
    for (int attempt = 0; attempt < 100 && stream == nullptr; ++attempt) {
        temporary = directory / (stem + randomSuffix() + ".tmp");
        errno = 0;
        stream = std::fopen(temporary.c_str(), "wx");
        if (stream == nullptr && errno != EEXIST) {
            return lastError();
        }
    }
    if (stream == nullptr) {
        return EEXIST;
    }

    if (std::optional<int> error = writeAndClose(stream, contents)) {
        fs::remove(temporary, ignored);
        return error;
    }
    if (exists) {
        fs::permissions(temporary, existing.permissions(), fs::perm_options::replace, ignored);
    }
    errno = 0;
    if (std::rename(temporary.c_str(), file.c_str()) != 0) {
        const int error = lastError();
        fs::remove(temporary, ignored);
        return error;
    }
    return std::nullopt;
}

// Writes contents to path. A regular file (also one reached through
// symbolic links) and a path that does not exist yet are replaced
// atomically; anything else that exists cannot be replaced by a rename
// (a terminal, a pipe, /dev/stdout) and is written in place, as is the
// target of a dangling link.
std::optional<int> writeDocument(const std::string &path, const std::string &contents) {
    if (path.empty()) {
        return ENOENT;
    }
    std::error_code error;
    const fs::file_status status = fs::status(path, error);
    if (fs::is_regular_file(status)) {
        const fs::path real = fs::canonical(path, error);
        return replaceFile(error ? fs::path(path) : real, contents);
    }
    if (status.type() == fs::file_type::not_found && !fs::is_symlink(fs::symlink_status(path, error))) {
        return replaceFile(path, contents);
    }
    return writeInPlace(path, contents);
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
    try {
        if (std::optional<int> error = writeDocument(_path, document)) {
            reportWriteFailure(std::strerror(*error));
        }
    } catch (const std::exception &exception) {
        // Only an exhausted memory gets here; the run still ends normally.
        reportWriteFailure(exception.what());
    }
}
