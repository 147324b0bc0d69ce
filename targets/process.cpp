#include "targets/process.h"

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <memory>
#include <new>
#include <span>
#include <string_view>
#include <unordered_set>

#include "targets/kernel_process.h"
#include "targets/user_process.h"

namespace {

// The run-wide global error list, created on first use.
std::once_flag globalErrorsOnce;
std::optional<std::vector<std::string>> globalErrorList;
std::vector<std::string> globalNoteList;
std::atomic<uint64_t> uncountedBytes{0};
std::atomic<uint32_t> uncountedProcesses{0};

// Text of a fixed-width, zero-padded field that need not be terminated.
std::string fixedField(const char *field, size_t width) {
    size_t length = 0;
    while (length < width && field[length] != '\0') {
        ++length;
    }
    return std::string(field, length);
}

bool isValidUtf8(std::string_view text) {
    size_t i = 0;
    while (i < text.size()) {
        const auto c = static_cast<unsigned char>(text[i]);
        size_t follow = 0;
        uint32_t codePoint = 0;
        if (c < 0x80) {
            ++i;
            continue;
        } else if ((c & 0xE0) == 0xC0) {
            follow = 1;
            codePoint = c & 0x1F;
        } else if ((c & 0xF0) == 0xE0) {
            follow = 2;
            codePoint = c & 0x0F;
        } else if ((c & 0xF8) == 0xF0) {
            follow = 3;
            codePoint = c & 0x07;
        } else {
            return false;
        }
        if (i + follow >= text.size()) {
            return false;
        }
        for (size_t k = 1; k <= follow; ++k) {
            const auto d = static_cast<unsigned char>(text[i + k]);
            if ((d & 0xC0) != 0x80) {
                return false;
            }
            codePoint = (codePoint << 6) | (d & 0x3F);
        }
        static constexpr uint32_t kSmallest[] = {0, 0x80, 0x800, 0x10000};
        if (codePoint < kSmallest[follow] || codePoint > 0x10FFFF ||
            (codePoint >= 0xD800 && codePoint <= 0xDFFF)) {
            return false;
        }
        i += follow + 1;
    }
    return true;
}

// Reads a decimal integer the way a number scanner does: white space
// skipped, an optional sign, then at least one digit; text after the digits
// is ignored. Values beyond 64 bits saturate, which no pid can equal.
std::optional<int64_t> scanInteger(const std::string &text) {
    size_t i = 0;
    while (i < text.size() && std::isspace(static_cast<unsigned char>(text[i]))) {
        ++i;
    }
    size_t digits = i;
    if (digits < text.size() && (text[digits] == '+' || text[digits] == '-')) {
        ++digits;
    }
    if (digits >= text.size() || !std::isdigit(static_cast<unsigned char>(text[digits]))) {
        return std::nullopt;
    }
    return std::strtoll(text.c_str() + i, nullptr, 10);
}

// One snapshot of the system's process list: the records that could be read,
// in the platform's pid order. nullopt when no record could be read.
std::optional<std::vector<VSBsdInfo>> takeProcessSnapshot() {
    VSPlatform &platform = VSPlatform::current();
    const int32_t count = platform.list_all_pids({});
    if (count < 0) {
        return std::nullopt;
    }
    // Slack for processes started between the two calls.
    std::vector<int32_t> pids(static_cast<size_t>(count) + 20);
    const int32_t stored = platform.list_all_pids(pids);
    if (stored < 0) {
        return std::nullopt;
    }
    pids.resize(std::min(static_cast<size_t>(stored), pids.size()));
    std::vector<VSBsdInfo> records;
    records.reserve(pids.size());
    for (int32_t pid : pids) {
        VSBsdInfo info;
        if (platform.pid_bsd_info(pid, info) == static_cast<int32_t>(sizeof(VSBsdInfo))) {
            records.push_back(info);
        }
    }
    if (records.empty()) {
        return std::nullopt;
    }
    return records;
}

}  // namespace

// ---- construction ---------------------------------------------------------------

VSProcess::VSProcess() = default;
VSProcess::~VSProcess() = default;

bool VSProcess::initWithBsdInfo(const VSBsdInfo &info) {
    _pid = static_cast<int32_t>(info.pid);
    _is64bit = (info.flags & vs::kBsdInfoFlag64Bit) != 0;
    if (!_populateTask()) {
        return false;
    }
    _name = _nameForBsdInfo(info);
    _displayString = _name + " [" + std::to_string(_pid) + "]";
    _pageSize = _gatherPageSize();
    return true;
}

std::unique_ptr<VSProcess> VSProcess::processWithBsdInfo(const VSBsdInfo &info) {
    std::unique_ptr<VSProcess> process;
    if ((info.flags & vs::kBsdInfoFlagSystem) != 0) {
        process = std::make_unique<VSKernelProcess>();
    } else {
        process = std::make_unique<VSUserProcess>();
    }
    if (!process->initWithBsdInfo(info)) {
        return nullptr;
    }
    return process;
}

std::unique_ptr<VSProcess> VSProcess::processWithPid(int32_t pid) {
    VSBsdInfo info;
    if (VSPlatform::current().pid_bsd_info(pid, info) != static_cast<int32_t>(sizeof(VSBsdInfo))) {
        return nullptr;
    }
    return processWithBsdInfo(info);
}

// ---- hooks ------------------------------------------------------------------------

uint64_t VSProcess::_gatherPageSize() { return VSPlatform::current().kernel_page_size(); }

bool VSProcess::_populateTask() { return false; }

void VSProcess::gatherData() {}

bool VSProcess::prepareGatherData() { return false; }

std::shared_ptr<const VSAuxDataDictionary> VSProcess::auxData() const {
    return std::make_shared<const VSAuxDataDictionary>();
}

bool VSProcess::_isAlive() const { return false; }

bool VSProcess::breakDownPhysVestage() const { return vs::readBreakDownPhysVestageSetting(); }

void VSProcess::setMemoryRegions(VSMemoryRegionList regions) {
    _memoryRegions = std::move(regions);
    _hasMemoryRegions = true;
}

// ---- global errors -----------------------------------------------------------------

void VSProcess::_addGlobalError(std::string error) {
    VSPlatform::run_once(globalErrorsOnce, [] { globalErrorList.emplace(); });
    globalErrorList->push_back(std::move(error));
}

void VSProcess::_clearGlobalErrors() {
    if (globalErrorList) {
        globalErrorList->clear();
    }
    globalNoteList.clear();
    uncountedBytes = 0;
    uncountedProcesses = 0;
}

void VSProcess::_addGlobalNote(std::string note) {
    if (std::find(globalNoteList.begin(), globalNoteList.end(), note) == globalNoteList.end()) {
        globalNoteList.push_back(std::move(note));
    }
}

std::vector<std::string> VSProcess::globalNotes() { return globalNoteList; }

void VSProcess::_addUncountedResident(uint64_t bytes) {
    uncountedBytes += bytes;
    uncountedProcesses += 1;
}

std::pair<uint64_t, uint32_t> VSProcess::uncountedResident() { return {uncountedBytes.load(), uncountedProcesses.load()}; }

std::vector<std::string> VSProcess::globalErrors() {
    if (!globalErrorList) {
        return {};
    }
    return *globalErrorList;
}

// ---- names -------------------------------------------------------------------------

std::string VSProcess::_nameForBsdInfoCommName(const VSBsdInfo &info) {
    if (info.name[0] != '\0') {
        return fixedField(info.name, sizeof(info.name));
    }
    if (info.commandName[0] != '\0') {
        return fixedField(info.commandName, sizeof(info.commandName));
    }
    return "Unknown";
}

std::string VSProcess::_nameForBsdInfo(const VSBsdInfo &info) {
    VSPlatform &platform = VSPlatform::current();
    int32_t areaSize = 0;
    if (platform.argument_area_max_size(areaSize) != 0 || areaSize <= 0) {
        return _nameForBsdInfoCommName(info);
    }
    // The area is as large as the longest argument list (megabytes), while
    // only its first bytes are ever stored for most processes: one buffer per
    // thread, never cleared, so that its untouched pages stay unallocated.
    thread_local std::unique_ptr<char[]> buffer;
    thread_local size_t bufferSize = 0;
    if (bufferSize < static_cast<size_t>(areaSize)) {
        buffer.reset();
        bufferSize = 0;
        try {
            buffer = std::make_unique_for_overwrite<char[]>(static_cast<size_t>(areaSize));
        } catch (const std::bad_alloc &) {
            return _nameForBsdInfoCommName(info);
        }
        bufferSize = static_cast<size_t>(areaSize);
    }
    const std::span<char> area(buffer.get(), static_cast<size_t>(areaSize));
    size_t length = 0;
    if (platform.process_argument_area(static_cast<int32_t>(info.pid), area, length) != 0) {
        return _nameForBsdInfoCommName(info);
    }
    length = std::min(length, area.size());
    // The area starts with the 32-bit argument count. It is skipped by its
    // width rather than by looking for its first zero byte, which a count
    // that is a multiple of 256 would put in the wrong place; the path then
    // follows after zero padding.
    constexpr size_t kArgumentCountWidth = 4;
    if (length <= kArgumentCountWidth) {
        return _nameForBsdInfoCommName(info);
    }
    area[length - 1] = '\0';
    size_t position = kArgumentCountWidth;
    while (position < length && area[position] == '\0') {
        ++position;
    }
    if (position >= length) {
        return _nameForBsdInfoCommName(info);
    }
    const std::string_view path(&area[position]);
    const size_t slash = path.rfind('/');
    const std::string_view name = slash == std::string_view::npos ? path : path.substr(slash + 1);
    // A name that is not valid text could be neither matched nor written to
    // the JSON report; the record's own name serves instead.
    if (!isValidUtf8(name)) {
        return _nameForBsdInfoCommName(info);
    }
    return std::string(name);
}

// ---- target discovery ------------------------------------------------------------

std::optional<VSTargetMap> VSProcess::allProcessesExcludingPids(const std::set<int32_t> &excludedPids) {
    auto snapshot = takeProcessSnapshot();
    if (!snapshot) {
        return std::nullopt;
    }
    VSTargetMap targets;
    for (const VSBsdInfo &info : *snapshot) {
        const auto pid = static_cast<int32_t>(info.pid);
        if (excludedPids.count(pid) != 0) {
            continue;
        }
        if (auto process = processWithBsdInfo(info)) {
            targets[pid] = std::move(process);
        }
    }
    return targets;
}

std::optional<VSPidTable> VSProcess::pidsForStringDescriptions(const std::vector<std::string> &descriptions,
                                                               std::vector<std::string> *errors) {
    auto snapshot = takeProcessSnapshot();
    if (!snapshot) {
        if (errors) {
            *errors = {"Unable to obtain system process list"};
        }
        return std::nullopt;
    }
    if (errors) {
        errors->clear();
    }
    // Each record's name is derived at most once per call, not once per
    // description.
    std::vector<std::optional<std::string>> names(snapshot->size());
    VSPidTable result;
    VSPlatform &platform = VSPlatform::current();
    auto isZombie = [&](int32_t pid) {
        VSShortInfo info;
        int32_t errorNumber = 0;
        return platform.pid_short_info(pid, info, errorNumber) == static_cast<int32_t>(sizeof(VSShortInfo)) &&
               info.runStatus == vs::kRunStatusZombie;
    };
    for (const std::string &description : descriptions) {
        const std::optional<int64_t> number = scanInteger(description);
        // Every record the description names, by name or as a number.
        std::vector<std::pair<int32_t, bool>> matches; // pid, by name
        for (size_t i = 0; i < snapshot->size(); ++i) {
            const VSBsdInfo &info = (*snapshot)[i];
            const auto pid = static_cast<int32_t>(info.pid);
            if (!names[i]) {
                names[i] = _nameForBsdInfo(info);
            }
            if (*names[i] == description) {
                matches.emplace_back(pid, true);
            } else if (number && *number == pid) {
                matches.emplace_back(pid, false);
            }
        }
        if (matches.empty()) {
            if (errors) {
                errors->push_back("Unable to find pid for process matching '" + description + "'");
            }
            continue;
        }
        // The first match, unless it is a zombie and a live process matches
        // too: a zombie has no memory left to show.
        size_t chosen = 0;
        const auto byName = std::count_if(matches.begin(), matches.end(), [](const auto &m) { return m.second; });
        if (byName > 1) {
            for (size_t i = 0; i < matches.size(); ++i) {
                if (matches[i].second && !isZombie(matches[i].first)) {
                    chosen = i;
                    break;
                }
            }
            if (errors) {
                std::string others;
                size_t listed = 0;
                for (size_t i = 0; i < matches.size(); ++i) {
                    if (i != chosen && matches[i].second && listed++ < 8) {
                        others += (others.empty() ? "" : ", ") + std::to_string(matches[i].first);
                    }
                }
                if (byName - 1 > 8) {
                    others += ", ...";
                }
                errors->push_back("'" + description + "' matches " + std::to_string(byName) +
                                  " processes; analysing " + std::to_string(matches[chosen].first) +
                                  "; pick another with --pid: " + others);
            }
        }
        const auto [pid, named] = matches[chosen];
        result[pid] = named ? std::optional<std::string>(description) : std::nullopt;
    }
    return result;
}

std::optional<std::vector<int32_t>> VSProcess::childPidsForPids(const std::vector<int32_t> &pids) {
    auto snapshot = takeProcessSnapshot();
    if (!snapshot) {
        return std::nullopt;
    }
    // The kernel's record names itself as its parent, so a walk from pid 0
    // would find 0 on every level. Never collecting a pid twice ends it (and
    // any other cycle); the caller keys its table by pid, so the duplicates
    // the guard leaves out would have been merged anyway.
    std::unordered_set<int32_t> collected(pids.begin(), pids.end());
    std::vector<int32_t> frontier = pids;
    std::vector<int32_t> result;
    while (!frontier.empty()) {
        std::unordered_set<int32_t> parents(frontier.begin(), frontier.end());
        std::vector<int32_t> next;
        for (const VSBsdInfo &info : *snapshot) {
            const auto pid = static_cast<int32_t>(info.pid);
            if (parents.count(static_cast<int32_t>(info.ppid)) != 0 && collected.insert(pid).second) {
                next.push_back(pid);
            }
        }
        result.insert(result.end(), frontier.begin(), frontier.end());
        frontier = std::move(next);
    }
    return result;
}

VSTargetMap VSProcess::removeIdleExitCleanProcessesFrom(VSTargetMap processes) {
    std::erase_if(processes, [](const auto &entry) {
        return entry.second && entry.second->idleExitStatus() == VSIdleExitClean;
    });
    return processes;
}

// ---- the breakdown switch ---------------------------------------------------------

namespace {
// Linux has no kernel setting for the breakdown, so the program keeps the
// switch itself; a kernel that has the setting still has the last word.
std::atomic<bool> programBreakDownFlag{false};
}  // namespace

void vs::setProgramBreakDownFlag(bool enabled) { programBreakDownFlag.store(enabled); }

bool vs::readBreakDownPhysVestageSetting() {
    int32_t value = 0;
    const int32_t error = VSPlatform::current().sysctl_by_name_read("vm.self_region_vestage", value);
    if (error != 0) {
        if (error != ENOENT) {
            std::fprintf(stderr, "Unable to retrieve status of physical vestage data collection: %s\n",
                         std::strerror(error));
            return false;
        }
        return programBreakDownFlag.load();
    }
    return value != 0;
}
