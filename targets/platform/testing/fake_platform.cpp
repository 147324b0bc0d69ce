#include "targets/platform/testing/fake_platform.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <iostream>

namespace {

constexpr int32_t kErrnoNoEntry = 2;
constexpr int32_t kErrnoNoMemory = 12;
constexpr int32_t kErrnoInvalid = 22;

// Copies text into a fixed field, zero-padded, cut at the field's size.
template <size_t N>
void setField(char (&field)[N], std::string_view text) {
    std::memset(field, 0, N);
    std::memcpy(field, text.data(), std::min(N, text.size()));
}

}  // namespace

// One kernel_memory_info answer; its buffers never move, so the spans the
// caller holds stay valid until release_memory.
struct VSFakePlatform::KernelArray {
    std::vector<VSKernelZoneName> names;
    std::vector<VSKernelZoneInfo> infos;
    std::vector<VSKernelSiteInfo> sites;
    uint64_t length = 0;
};

class VSFakeKernelSymbolicatorImpl : public VSKernelSymbolicator {
public:
    explicit VSFakeKernelSymbolicatorImpl(std::vector<VSFakeKernelSymbol> symbols) : _symbols(std::move(symbols)) {}

    std::optional<std::string> symbol_name_at(uint64_t address) const override {
        const VSFakeKernelSymbol *symbol = _find(address);
        return symbol ? std::optional<std::string>(symbol->name) : std::nullopt;
    }
    std::optional<VSSourceLocation> source_location_at(uint64_t address) const override {
        const VSFakeKernelSymbol *symbol = _find(address);
        return symbol ? symbol->location : std::nullopt;
    }

private:
    const VSFakeKernelSymbol *_find(uint64_t address) const {
        for (const VSFakeKernelSymbol &symbol : _symbols) {
            if (address >= symbol.start && address - symbol.start < symbol.size) {
                return &symbol;
            }
        }
        return nullptr;
    }
    std::vector<VSFakeKernelSymbol> _symbols;
};

// ---- region builder -----------------------------------------------------------------

VSFakeRegionBuilder &VSFakeRegionBuilder::tag(uint32_t userTag) { _region->info.userTag = userTag; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::resident(uint32_t pages) { _region->info.residentPages = pages; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::dirtied(uint32_t pages) { _region->info.dirtiedPages = pages; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::swappedOut(uint32_t pages) { _region->info.swappedOutPages = pages; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::reusable(uint32_t pages) { _region->info.reusablePages = pages; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::sharedNowPrivate(uint32_t pages) {
    _region->info.sharedNowPrivatePages = pages;
    return *this;
}
VSFakeRegionBuilder &VSFakeRegionBuilder::wired(uint16_t pages) { _region->info.userWiredCount = pages; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::referenceCount(uint32_t count) { _region->info.referenceCount = count; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::shareMode(uint8_t mode) { _region->info.shareMode = mode; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::objectId(uint32_t id) { _region->info.objectId = id; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::offset(uint64_t offset) { _region->info.offset = offset; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::protection(int32_t current, int32_t maximum) {
    _region->info.protection = current;
    _region->info.maxProtection = maximum;
    return *this;
}
VSFakeRegionBuilder &VSFakeRegionBuilder::inheritance(uint32_t inheritance) {
    _region->info.inheritance = inheritance;
    return *this;
}
VSFakeRegionBuilder &VSFakeRegionBuilder::behaviour(int32_t behaviour) { _region->info.behaviour = behaviour; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::external(bool backedByFile) {
    _region->info.externalPager = backedByFile ? 1 : 0;
    return *this;
}
VSFakeRegionBuilder &VSFakeRegionBuilder::file(std::string path) {
    _region->path = std::move(path);
    _region->info.externalPager = 1;
    return *this;
}
VSFakeRegionBuilder &VSFakeRegionBuilder::path(std::string path) { _region->path = std::move(path); return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::purgeable(int32_t state) { _region->purgeableState = state; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::submapFlag(bool set) { _region->info.isSubmap = set ? 1 : 0; return *this; }
VSFakeRegionBuilder &VSFakeRegionBuilder::info(const VSRegionInfo &record) { _region->info = record; return *this; }

VSFakeRegionBuilder &VSFakeRegionBuilder::pages(const std::vector<int32_t> &words) {
    uint64_t pageSize = _fake->_pageSize;
    uint64_t first = _region->start / pageSize * pageSize;
    for (size_t i = 0; i < words.size(); ++i) {
        _process->pageDispositions[first + i * pageSize] = words[i];
    }
    return *this;
}

VSFakeRegionBuilder VSFakeRegionBuilder::nested(uint64_t start, uint64_t size) {
    _region->submap = true;
    VSFakeRegion &inner = _process->regions[{start, _region->depth + 1}];
    inner = VSFakeRegion{};
    inner.start = start;
    inner.size = size;
    inner.depth = _region->depth + 1;
    inner.info.protection = vs::kProtRead | vs::kProtWrite;
    inner.info.maxProtection = vs::kProtRead | vs::kProtWrite | vs::kProtExecute;
    inner.info.inheritance = vs::kInheritCopy;
    inner.info.shareMode = vs::kShareModePrivate;
    inner.info.objectId = _fake->_nextObjectId++;
    return VSFakeRegionBuilder(*_fake, *_process, inner);
}

// ---- image, site, kernel builders ------------------------------------------------------

VSFakeImageBuilder &VSFakeImageBuilder::segment(std::string name, uint64_t start, uint64_t length) {
    _process->images[_index].segments.push_back({std::move(name), start, length});
    return *this;
}

VSFakeSiteBuilder &VSFakeSiteBuilder::mapped(uint64_t bytes) { record().mapped = bytes; return *this; }
VSFakeSiteBuilder &VSFakeSiteBuilder::zone(uint16_t index) {
    record().zone = index;
    record().flags |= vs::kSiteFlagZoneShare;
    return *this;
}
VSFakeSiteBuilder &VSFakeSiteBuilder::name(std::string_view name) {
    setField(record().name, name);
    record().flags |= vs::kSiteFlagNamed;
    return *this;
}

VSFakeKernelBuilder &VSFakeKernelBuilder::zone(std::string_view name, uint64_t elementsInUse, uint64_t currentSize,
                                               uint64_t elementSize, bool collectable) {
    VSKernelZoneInfo info;
    info.elementsInUse = elementsInUse;
    info.currentSize = currentSize;
    info.elementSize = elementSize;
    info.collectable = collectable ? 1 : 0;
    return zone(name, info);
}

VSFakeKernelBuilder &VSFakeKernelBuilder::zone(std::string_view name, const VSKernelZoneInfo &info) {
    VSKernelZoneName zoneName;
    setField(zoneName.name, name);
    _fake->_zoneNames.push_back(zoneName);
    _fake->_zoneInfos.push_back(info);
    return *this;
}

VSFakeSiteBuilder VSFakeKernelBuilder::site(uint64_t flags, uint64_t site, uint64_t size) {
    VSKernelSiteInfo info;
    info.flags = flags;
    info.site = site;
    info.size = size;
    _fake->_sites.push_back(info);
    return VSFakeSiteBuilder(_fake->_sites, _fake->_sites.size() - 1);
}

VSFakeKernelBuilder &VSFakeKernelBuilder::kext(std::string bundleIdentifier, uint64_t loadTag) {
    VSKextInfo info;
    info.loadTag = loadTag;
    info.bundleIdentifier = bundleIdentifier;
    _fake->_kexts[std::move(bundleIdentifier)] = info;
    return *this;
}

VSFakeKernelBuilder &VSFakeKernelBuilder::kextWithoutBundleIdentifier(std::string key, uint64_t loadTag) {
    VSKextInfo info;
    info.loadTag = loadTag;
    _fake->_kexts[std::move(key)] = info;
    return *this;
}

VSFakeKernelBuilder &VSFakeKernelBuilder::symbol(uint64_t start, uint64_t size, std::string name) {
    _fake->_kernelSymbols.push_back({start, size, std::move(name), std::nullopt});
    return *this;
}

VSFakeKernelBuilder &VSFakeKernelBuilder::sourceLocation(uint64_t start, std::optional<std::string> path,
                                                         uint32_t line) {
    for (VSFakeKernelSymbol &symbol : _fake->_kernelSymbols) {
        if (symbol.start == start) {
            symbol.location = VSSourceLocation{std::move(path), line};
            return *this;
        }
    }
    _fake->_kernelSymbols.push_back({start, 1, std::string(), VSSourceLocation{std::move(path), line}});
    return *this;
}

// ---- process builder ---------------------------------------------------------------------

VSTaskHandle VSFakeProcessBuilder::handle() const { return VSFakePlatform::handleFor(_process->pid); }

VSFakeProcessBuilder &VSFakeProcessBuilder::parent(int32_t ppid) {
    _process->bsdInfo.ppid = static_cast<uint32_t>(ppid);
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::name(std::string_view name) {
    setField(_process->bsdInfo.name, name);
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::commandName(std::string_view name) {
    setField(_process->bsdInfo.commandName, name);
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::flags(uint32_t flags) { _process->bsdInfo.flags = flags; return *this; }
VSFakeProcessBuilder &VSFakeProcessBuilder::is64bit(bool is64bit) {
    if (is64bit) {
        _process->bsdInfo.flags |= vs::kBsdInfoFlag64Bit;
    } else {
        _process->bsdInfo.flags &= ~vs::kBsdInfoFlag64Bit;
    }
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::bsdInfo(const VSBsdInfo &record) { _process->bsdInfo = record; return *this; }

VSFakeProcessBuilder &VSFakeProcessBuilder::executable(std::string_view path, const std::vector<std::string> &arguments) {
    uint32_t argc = static_cast<uint32_t>(arguments.size());
    std::string area;
    for (int i = 0; i < 4; ++i) {
        area.push_back(static_cast<char>((argc >> (8 * i)) & 0xFF));  // little-endian count
    }
    area.append(path);
    // The path is followed by zero padding up to pointer alignment.
    do {
        area.push_back('\0');
    } while (area.size() % 8 != 0);
    for (const std::string &argument : arguments) {
        area.append(argument);
        area.push_back('\0');
    }
    _process->argumentArea = std::move(area);
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::argumentArea(std::string bytes) {
    _process->argumentArea = std::move(bytes);
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::resourceUsage(uint64_t physVestage, uint64_t lifetimeMaxPhysVestage) {
    _process->resourceUsage.physVestage = physVestage;
    _process->resourceUsage.lifetimeMaxPhysVestage = lifetimeMaxPhysVestage;
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::residentSize(uint64_t bytes) {
    _process->resourceUsage.residentSize = bytes;
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::dirtyFlags(uint32_t flags) { _process->dirtyFlags = flags; return *this; }
VSFakeProcessBuilder &VSFakeProcessBuilder::kernelMemory(uint64_t privateAllocated, uint64_t privateFreed,
                                                         uint64_t sharedAllocated, uint64_t sharedFreed) {
    _process->kernelMemory = {privateAllocated, privateFreed, sharedAllocated, sharedFreed};
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::platformCode(uint64_t code) { _process->platformCode = code; return *this; }
VSFakeProcessBuilder &VSFakeProcessBuilder::refuseTaskHandle(VSReturnCode code) {
    return failAlways(VSFakeQuery::TaskHandleForPid, code);
}

VSFakeProcessBuilder &VSFakeProcessBuilder::zombie() { _process->state = VSFakeProcessState::Zombie; return *this; }
VSFakeProcessBuilder &VSFakeProcessBuilder::exited() { _process->state = VSFakeProcessState::Exited; return *this; }
VSFakeProcessBuilder &VSFakeProcessBuilder::corpse() { _process->listed = false; return *this; }
VSFakeProcessBuilder &VSFakeProcessBuilder::exitsAt(VSFakeQuery query, uint64_t call) {
    _process->stateChanges.push_back({query, call, VSFakeProcessState::Exited});
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::becomesZombieAt(VSFakeQuery query, uint64_t call) {
    _process->stateChanges.push_back({query, call, VSFakeProcessState::Zombie});
    return *this;
}

VSFakeProcessBuilder &VSFakeProcessBuilder::failOnCall(VSFakeQuery query, uint64_t call, int32_t code) {
    _fake->addFailure({query, _process->pid, call, call, code});
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::failFromCall(VSFakeQuery query, uint64_t call, int32_t code) {
    _fake->addFailure({query, _process->pid, call, UINT64_MAX, code});
    return *this;
}
VSFakeProcessBuilder &VSFakeProcessBuilder::failAlways(VSFakeQuery query, int32_t code) {
    return failFromCall(query, 1, code);
}

VSFakeRegionBuilder VSFakeProcessBuilder::region(uint64_t start, uint64_t size) {
    VSFakeRegion &region = _process->regions[{start, 0}];
    region = VSFakeRegion{};
    region.start = start;
    region.size = size;
    region.info.protection = vs::kProtRead | vs::kProtWrite;
    region.info.maxProtection = vs::kProtRead | vs::kProtWrite | vs::kProtExecute;
    region.info.inheritance = vs::kInheritCopy;
    region.info.shareMode = vs::kShareModePrivate;
    region.info.objectId = _fake->_nextObjectId++;
    return VSFakeRegionBuilder(*_fake, *_process, region);
}

VSFakeProcessBuilder &VSFakeProcessBuilder::pages(uint64_t address, const std::vector<int32_t> &words) {
    uint64_t pageSize = _fake->_pageSize;
    uint64_t first = address / pageSize * pageSize;
    for (size_t i = 0; i < words.size(); ++i) {
        _process->pageDispositions[first + i * pageSize] = words[i];
    }
    return *this;
}

VSFakeProcessBuilder &VSFakeProcessBuilder::purgeableAt(uint64_t address, int32_t state) {
    _process->purgeableByAddress[address] = state;
    return *this;
}

VSFakeImageBuilder VSFakeProcessBuilder::image(std::string path) {
    _process->images.push_back({std::move(path), {}});
    return VSFakeImageBuilder(*_process, _process->images.size() - 1);
}

// ---- the fake: scripting --------------------------------------------------------------------

VSFakePlatform::VSFakePlatform() : _errorStream(&std::cerr) {}

VSFakePlatform::~VSFakePlatform() {
    if (VSPlatform::installed() == this) {
        VSPlatform::setCurrent(nullptr);
    }
}

std::unique_ptr<VSFakePlatform::Installation> VSFakePlatform::install() {
    auto installation = std::make_unique<Installation>(VSPlatform::installed());
    VSPlatform::setCurrent(this);
    return installation;
}

VSFakeProcessBuilder VSFakePlatform::process(int32_t pid, std::string_view name) {
    auto [it, created] = _processes.try_emplace(pid);
    VSFakeProcess &process = it->second;
    if (created) {
        process.pid = pid;
        process.bsdInfo.pid = static_cast<uint32_t>(pid);
        process.bsdInfo.ppid = pid <= 1 ? 0 : 1;
        process.bsdInfo.flags = vs::kBsdInfoFlag64Bit;
        _listOrder.push_back(pid);
    }
    VSFakeProcessBuilder builder(*this, process);
    if (!name.empty()) {
        builder.name(name).commandName(name);
    }
    return builder;
}

VSFakeProcessBuilder VSFakePlatform::kernelProcess() {
    return process(0, "kernel").parent(0).flags(vs::kBsdInfoFlagSystem | vs::kBsdInfoFlag64Bit);
}

VSFakePlatform &VSFakePlatform::pageSize(uint64_t bytes) { _pageSize = bytes; return *this; }
VSFakePlatform &VSFakePlatform::ownPid(int32_t pid) { _ownPid = pid; return *this; }
VSFakePlatform &VSFakePlatform::effectiveUserId(uint32_t uid) { _effectiveUserId = uid; return *this; }
VSFakePlatform &VSFakePlatform::argumentMax(int32_t bytes) { _argumentMax = bytes; return *this; }
VSFakePlatform &VSFakePlatform::platformCodeForAll(uint64_t code) { _platformCodeForAll = code; return *this; }
VSFakePlatform &VSFakePlatform::tagName(uint32_t tag, std::string name) { _tagNames[tag] = std::move(name); return *this; }
VSFakePlatform &VSFakePlatform::errorText(VSReturnCode code, std::string text) {
    _errorTexts[code] = std::move(text);
    return *this;
}
VSFakePlatform &VSFakePlatform::setting(std::string name, int32_t value) {
    _settings[std::move(name)] = value;
    return *this;
}
VSFakePlatform &VSFakePlatform::ports(std::vector<uint32_t> ports) { _ports = std::move(ports); return *this; }
VSFakePlatform &VSFakePlatform::corpsePort(int32_t pid) { return ports({handleFor(pid)}); }
VSFakePlatform &VSFakePlatform::errorStream(std::ostream *stream) { _errorStream = stream; return *this; }

VSFakePlatform &VSFakePlatform::failOnCall(VSFakeQuery query, uint64_t call, int32_t code) {
    return addFailure({query, std::nullopt, call, call, code});
}
VSFakePlatform &VSFakePlatform::failFromCall(VSFakeQuery query, uint64_t call, int32_t code) {
    return addFailure({query, std::nullopt, call, UINT64_MAX, code});
}
VSFakePlatform &VSFakePlatform::failAlways(VSFakeQuery query, int32_t code) { return failFromCall(query, 1, code); }
VSFakePlatform &VSFakePlatform::addFailure(const VSFakeFailure &failure) {
    std::lock_guard lock(_mutex);
    _failures.push_back(failure);
    return *this;
}

// ---- the fake: inspection ---------------------------------------------------------------------

uint64_t VSFakePlatform::callCount(VSFakeQuery query) const {
    std::lock_guard lock(_mutex);
    auto it = _callCounts.find(query);
    return it == _callCounts.end() ? 0 : it->second;
}

uint64_t VSFakePlatform::callCount(VSFakeQuery query, int32_t pid) const {
    std::lock_guard lock(_mutex);
    auto it = _pidCallCounts.find({pid, query});
    return it == _pidCallCounts.end() ? 0 : it->second;
}

std::vector<VSFakeCall> VSFakePlatform::calls(VSFakeQuery query) const {
    std::lock_guard lock(_mutex);
    std::vector<VSFakeCall> result;
    for (const VSFakeCall &call : _calls) {
        if (call.query == query) {
            result.push_back(call);
        }
    }
    return result;
}

std::vector<VSFakeCall> VSFakePlatform::allCalls() const {
    std::lock_guard lock(_mutex);
    return _calls;
}

std::vector<std::pair<std::string, VSReturnCode>> VSFakePlatform::reportedErrors() const {
    std::lock_guard lock(_mutex);
    return _reportedErrors;
}

std::vector<std::pair<std::string, int32_t>> VSFakePlatform::settingWrites() const {
    std::lock_guard lock(_mutex);
    return _settingWrites;
}

std::optional<int32_t> VSFakePlatform::settingValue(const std::string &name) const {
    std::lock_guard lock(_mutex);
    auto it = _settings.find(name);
    return it == _settings.end() ? std::nullopt : std::optional<int32_t>(it->second);
}

uint32_t VSFakePlatform::openTaskHandles() const {
    std::lock_guard lock(_mutex);
    uint32_t open = 0;
    for (const auto &[pid, process] : _processes) {
        open += process.openHandles;
    }
    return open;
}

size_t VSFakePlatform::outstandingKernelArrays() const {
    std::lock_guard lock(_mutex);
    return _kernelArrays.size();
}

void VSFakePlatform::clearCalls() {
    std::lock_guard lock(_mutex);
    _calls.clear();
    _callCounts.clear();
    _pidCallCounts.clear();
    _reportedErrors.clear();
    _settingWrites.clear();
}

// ---- the fake: internals --------------------------------------------------------------------

std::optional<int32_t> VSFakePlatform::_enter(VSFakeQuery query, VSFakeProcess *process) {
    uint64_t call = ++_callCounts[query];
    uint64_t pidCall = 0;
    if (process) {
        pidCall = ++_pidCallCounts[{process->pid, query}];
        for (const VSFakeStateChange &change : process->stateChanges) {
            if (change.query == query && change.call == pidCall) {
                process->state = change.state;
            }
        }
    }
    for (const VSFakeFailure &failure : _failures) {
        if (failure.query != query) {
            continue;
        }
        uint64_t n = call;
        if (failure.pid) {
            if (!process || process->pid != *failure.pid) {
                continue;
            }
            n = pidCall;
        }
        if (n >= failure.firstCall && n <= failure.lastCall) {
            return failure.code;
        }
    }
    return std::nullopt;
}

int32_t VSFakePlatform::_log(VSFakeCall call) {
    _calls.push_back(call);
    return call.result;
}

VSFakeProcess *VSFakePlatform::_processForPid(int32_t pid) {
    auto it = _processes.find(pid);
    return it == _processes.end() ? nullptr : &it->second;
}

VSFakeProcess *VSFakePlatform::_processForTask(VSTaskHandle task) {
    if (task < handleFor(0)) {
        return nullptr;
    }
    return _processForPid(static_cast<int32_t>(task - handleFor(0)));
}

bool VSFakePlatform::_isAlive(const VSFakeProcess *process) {
    return process && process->listed && process->state != VSFakeProcessState::Exited;
}

bool VSFakePlatform::_memoryReadable(const VSFakeProcess *process) {
    return process && process->state == VSFakeProcessState::Running;
}

const VSFakeRegion *VSFakePlatform::_regionContaining(const VSFakeProcess &process, uint64_t address) const {
    const VSFakeRegion *deepest = nullptr;
    for (const auto &[key, region] : process.regions) {
        if (address >= region.start && address < region.end() && (!deepest || region.depth > deepest->depth)) {
            deepest = &region;
        }
    }
    return deepest;
}

// The first region at nesting `level` inside [low, high) that ends above
// `address`, descending into submaps while the level is below maxDepth. A
// submap with nothing left at or above the address passes the search on to
// the entries after it.
const VSFakeRegion *VSFakePlatform::_findRecursive(const VSFakeProcess &process, uint32_t level, uint64_t low,
                                                   uint64_t high, uint64_t address, uint32_t maxDepth) const {
    uint64_t from = std::max(address, low);
    for (const auto &[key, region] : process.regions) {
        if (region.start >= high) {
            break;
        }
        if (region.depth != level || region.end() <= from) {
            continue;
        }
        if (region.submap && level < maxDepth) {
            if (const VSFakeRegion *inner = _findRecursive(process, level + 1, region.start, region.end(), address,
                                                           maxDepth)) {
                return inner;
            }
            continue;
        }
        return &region;
    }
    return nullptr;
}

// ---- the fake: processes ------------------------------------------------------------------

int32_t VSFakePlatform::list_all_pids(std::span<int32_t> buffer) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::ListAllPids, -1, 0, 0, buffer.size(), 0};
    if (auto failure = _enter(VSFakeQuery::ListAllPids, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    int32_t stored = 0;
    for (int32_t pid : _listOrder) {
        if (!_isAlive(_processForPid(pid))) {
            continue;
        }
        if (!buffer.empty()) {
            if (static_cast<size_t>(stored) == buffer.size()) {
                break;
            }
            buffer[stored] = pid;
        }
        ++stored;
    }
    call.result = stored;
    return _log(call);
}

int32_t VSFakePlatform::pid_bsd_info(int32_t pid, VSBsdInfo &info) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::PidBsdInfo, pid, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::PidBsdInfo, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_isAlive(process)) {
        return _log(call);
    }
    info = process->bsdInfo;
    call.result = sizeof(VSBsdInfo);
    return _log(call);
}

int32_t VSFakePlatform::pid_short_info(int32_t pid, VSShortInfo &info, int32_t &errorNumber) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::PidShortInfo, pid, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::PidShortInfo, process)) {
        errorNumber = *failure;
        return _log(call);
    }
    if (!_isAlive(process)) {
        errorNumber = vs::kErrorNoSuchProcess;
        return _log(call);
    }
    info = VSShortInfo{};
    info.runStatus = process->state == VSFakeProcessState::Zombie ? vs::kRunStatusZombie : 2;
    call.result = sizeof(VSShortInfo);
    return _log(call);
}

int32_t VSFakePlatform::pid_dirty_flags(int32_t pid, uint32_t &flags) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::PidDirtyFlags, pid, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::PidDirtyFlags, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_isAlive(process)) {
        call.result = vs::kErrorNoSuchProcess;
        return _log(call);
    }
    flags = process->dirtyFlags;
    return _log(call);
}

int32_t VSFakePlatform::pid_resource_usage(int32_t pid, int32_t version, VSResourceUsageInfo &info) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::PidResourceUsage, pid, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::PidResourceUsage, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (version != vs::kResourceUsageVersion4) {
        call.result = kErrnoInvalid;
    } else if (!_isAlive(process)) {
        call.result = vs::kErrorNoSuchProcess;
    } else {
        info = process->resourceUsage;
    }
    return _log(call);
}

int32_t VSFakePlatform::pid_region_filename(int32_t pid, uint64_t address, std::span<char> buffer) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::PidRegionFilename, pid, address, 0, buffer.size(), 0};
    if (auto failure = _enter(VSFakeQuery::PidRegionFilename, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_isAlive(process) || process->state != VSFakeProcessState::Running) {
        return _log(call);
    }
    if (const VSFakeRegion *region = _regionContaining(*process, address)) {
        size_t length = std::min(region->path.size(), buffer.size());
        std::memcpy(buffer.data(), region->path.data(), length);
        call.result = static_cast<int32_t>(length);
    }
    return _log(call);
}

int32_t VSFakePlatform::argument_area_max_size(int32_t &size) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::ArgumentAreaMaxSize, -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::ArgumentAreaMaxSize, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    size = _argumentMax;
    return _log(call);
}

int32_t VSFakePlatform::process_argument_area(int32_t pid, std::span<char> buffer, size_t &length) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::ProcessArgumentArea, pid, 0, 0, buffer.size(), 0};
    if (auto failure = _enter(VSFakeQuery::ProcessArgumentArea, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_isAlive(process)) {
        call.result = vs::kErrorNoSuchProcess;
    } else if (!process->argumentArea) {
        call.result = kErrnoInvalid;
    } else if (process->argumentArea->size() > buffer.size()) {
        call.result = kErrnoNoMemory;
    } else {
        std::memcpy(buffer.data(), process->argumentArea->data(), process->argumentArea->size());
        length = process->argumentArea->size();
    }
    return _log(call);
}

uint64_t VSFakePlatform::target_platform_code(int32_t pid, bool is64bit) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    _enter(VSFakeQuery::TargetPlatformCode, process);
    _log({VSFakeQuery::TargetPlatformCode, pid, 0, 0, 0, 0});
    if (process && process->platformCode) {
        return *process->platformCode;
    }
    if (_platformCodeForAll) {
        return *_platformCodeForAll;
    }
    return is64bit ? VSPlatformARM64 : VSPlatformARM;
}

// ---- the fake: tasks ------------------------------------------------------------------------

VSReturnCode VSFakePlatform::task_handle_for_pid(int32_t pid, VSTaskHandle &task) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForPid(pid);
    VSFakeCall call{VSFakeQuery::TaskHandleForPid, pid, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::TaskHandleForPid, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_isAlive(process)) {
        call.result = vs::kErrorNoSuchProcess;
        return _log(call);
    }
    ++process->openHandles;
    task = handleFor(pid);
    return _log(call);
}

VSReturnCode VSFakePlatform::release_task_handle(VSTaskHandle task) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::ReleaseTaskHandle, process ? process->pid : -1, task, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::ReleaseTaskHandle, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!process || process->openHandles == 0) {
        call.result = vs::kReturnInvalidArgument;
    } else {
        --process->openHandles;
    }
    return _log(call);
}

VSReturnCode VSFakePlatform::region_recurse(VSTaskHandle task, uint64_t &address, uint64_t &size, uint32_t &depth,
                                            VSRegionInfo &info, uint32_t &infoCount) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::RegionRecurse, process ? process->pid : -1, address, 0, infoCount, 0};
    if (auto failure = _enter(VSFakeQuery::RegionRecurse, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_memoryReadable(process)) {
        call.result = vs::kReturnDeadPort;
        return _log(call);
    }
    if (infoCount < vs::kRegionInfoCount) {
        call.result = vs::kReturnInvalidArgument;
        return _log(call);
    }
    const VSFakeRegion *region = _findRecursive(*process, 0, 0, UINT64_MAX, address, depth);
    if (!region) {
        call.result = vs::kReturnNoMoreRegions;
        return _log(call);
    }
    address = region->start;
    size = region->size;
    depth = region->depth;
    info = region->info;
    if (region->submap) {
        info.isSubmap = 1;  // the depth limit stopped the descent here
    }
    infoCount = vs::kRegionInfoCount;
    return _log(call);
}

VSReturnCode VSFakePlatform::region_info(VSTaskHandle task, uint64_t &address, uint64_t &size, int32_t flavor,
                                         VSRegionBasicInfo &info, uint32_t &infoCount, uint32_t &objectName) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::RegionInfo, process ? process->pid : -1, address, 0, infoCount, 0};
    if (auto failure = _enter(VSFakeQuery::RegionInfo, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_memoryReadable(process)) {
        call.result = vs::kReturnDeadPort;
        return _log(call);
    }
    if (flavor != vs::kRegionBasicInfoFlavor || infoCount < vs::kRegionBasicInfoCount) {
        call.result = vs::kReturnInvalidArgument;
        return _log(call);
    }
    const VSFakeRegion *region = _findRecursive(*process, 0, 0, UINT64_MAX, address, 0);
    if (!region) {
        call.result = vs::kReturnNoMoreRegions;
        return _log(call);
    }
    address = region->start;
    size = region->size;
    info = VSRegionBasicInfo{};
    info.protection = region->info.protection;
    info.maxProtection = region->info.maxProtection;
    info.inheritance = region->info.inheritance;
    info.shared = region->info.shareMode == vs::kShareModeShared ? 1 : 0;
    info.offset = region->info.offset;
    info.behaviour = region->info.behaviour;
    info.userWiredCount = region->info.userWiredCount;
    infoCount = vs::kRegionBasicInfoCount;
    objectName = 0;
    return _log(call);
}

VSReturnCode VSFakePlatform::page_range_query(VSTaskHandle task, uint64_t address, uint64_t length,
                                              std::span<int32_t> dispositions, uint64_t &count) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::PageRangeQuery, process ? process->pid : -1, address, length, dispositions.size(), 0};
    if (auto failure = _enter(VSFakeQuery::PageRangeQuery, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_memoryReadable(process)) {
        call.result = vs::kReturnInvalidArgument;
        return _log(call);
    }
    uint64_t first = address / _pageSize * _pageSize;
    uint64_t end = (address + length + _pageSize - 1) / _pageSize * _pageSize;
    uint64_t pages = std::min<uint64_t>((end - first) / _pageSize, dispositions.size());
    for (uint64_t i = 0; i < pages; ++i) {
        auto it = process->pageDispositions.find(first + i * _pageSize);
        dispositions[i] = it == process->pageDispositions.end() ? 0 : it->second;
    }
    count = pages;
    return _log(call);
}

VSReturnCode VSFakePlatform::purgeable_control(VSTaskHandle task, uint64_t address, int32_t operation,
                                               int32_t &state) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::PurgeableControl, process ? process->pid : -1, address, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::PurgeableControl, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_memoryReadable(process)) {
        call.result = vs::kReturnDeadPort;
        return _log(call);
    }
    if (operation != vs::kPurgeableGetState) {
        call.result = vs::kReturnInvalidArgument;
        return _log(call);
    }
    if (auto it = process->purgeableByAddress.find(address); it != process->purgeableByAddress.end()) {
        state = it->second;
        return _log(call);
    }
    const VSFakeRegion *region = _regionContaining(*process, address);
    if (!region || !region->purgeableState) {
        call.result = vs::kReturnInvalidArgument;
        return _log(call);
    }
    state = *region->purgeableState;
    return _log(call);
}

VSReturnCode VSFakePlatform::task_memory_info(VSTaskHandle task, VSTaskKernelMemoryInfo &info, uint32_t &count) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::TaskMemoryInfo, process ? process->pid : -1, 0, 0, count, 0};
    if (auto failure = _enter(VSFakeQuery::TaskMemoryInfo, process)) {
        call.result = *failure;
        return _log(call);
    }
    if (!_memoryReadable(process)) {
        call.result = vs::kReturnDeadPort;
    } else if (count < vs::kTaskKernelMemoryInfoCount) {
        call.result = vs::kReturnInvalidArgument;
    } else {
        info = process->kernelMemory;
        count = vs::kTaskKernelMemoryInfoCount;
    }
    return _log(call);
}

std::vector<VSSymbolicatorImage> VSFakePlatform::symbolicator(VSTaskHandle task, uint32_t /*flags*/) {
    std::lock_guard lock(_mutex);
    VSFakeProcess *process = _processForTask(task);
    VSFakeCall call{VSFakeQuery::Symbolicator, process ? process->pid : -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::Symbolicator, process)) {
        call.result = *failure;
        _log(call);
        return {};
    }
    _log(call);
    if (!_memoryReadable(process)) {
        return {};
    }
    return process->images;
}

// ---- the fake: codes and system facts ----------------------------------------------------------

uint64_t VSFakePlatform::kernel_page_size() {
    std::lock_guard lock(_mutex);
    return _pageSize;
}

std::string VSFakePlatform::error_text(VSReturnCode code) {
    std::lock_guard lock(_mutex);
    if (auto it = _errorTexts.find(code); it != _errorTexts.end()) {
        return it->second;
    }
    switch (code) {
        case vs::kReturnSuccess: return "success";
        case vs::kReturnNoMoreRegions: return "no region at or above the address";
        case vs::kReturnInvalidArgument: return "invalid argument";
        case vs::kReturnDeadPort: return "message to a dead port";
        default: break;
    }
    char text[32];
    std::snprintf(text, sizeof text, "error 0x%x", static_cast<unsigned>(code));
    return text;
}

void VSFakePlatform::report_error_code(std::string_view label, VSReturnCode code) {
    std::string text = error_text(code);
    std::lock_guard lock(_mutex);
    _enter(VSFakeQuery::ReportErrorCode, nullptr);
    _log({VSFakeQuery::ReportErrorCode, -1, 0, 0, 0, code});
    _reportedErrors.emplace_back(std::string(label), code);
    if (_errorStream) {
        *_errorStream << label << ": " << text << "\n";
    }
}

std::optional<std::string> VSFakePlatform::dynamic_tag_name(uint32_t tag) {
    std::lock_guard lock(_mutex);
    auto it = _tagNames.find(tag);
    return it == _tagNames.end() ? std::nullopt : std::optional<std::string>(it->second);
}

// ---- the fake: kernel -------------------------------------------------------------------------

VSReturnCode VSFakePlatform::kernel_memory_info(std::span<const VSKernelZoneName> &zoneNames,
                                                std::span<const VSKernelZoneInfo> &zoneInfos,
                                                std::span<const VSKernelSiteInfo> &siteInfos) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::KernelMemoryInfo, -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::KernelMemoryInfo, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    // Every array gets a buffer of its own, also when empty, so that each
    // has a distinct address to be released under.
    auto names = std::make_unique<KernelArray>();
    names->names.reserve(std::max<size_t>(1, _zoneNames.size()));
    names->names.assign(_zoneNames.begin(), _zoneNames.end());
    names->length = names->names.size() * sizeof(VSKernelZoneName);
    auto infos = std::make_unique<KernelArray>();
    infos->infos.reserve(std::max<size_t>(1, _zoneInfos.size()));
    infos->infos.assign(_zoneInfos.begin(), _zoneInfos.end());
    infos->length = infos->infos.size() * sizeof(VSKernelZoneInfo);
    auto sites = std::make_unique<KernelArray>();
    sites->sites.reserve(std::max<size_t>(1, _sites.size()));
    sites->sites.assign(_sites.begin(), _sites.end());
    sites->length = sites->sites.size() * sizeof(VSKernelSiteInfo);

    zoneNames = std::span<const VSKernelZoneName>(names->names.data(), names->names.size());
    zoneInfos = std::span<const VSKernelZoneInfo>(infos->infos.data(), infos->infos.size());
    siteInfos = std::span<const VSKernelSiteInfo>(sites->sites.data(), sites->sites.size());
    _kernelArrays[names->names.data()] = std::move(names);
    _kernelArrays[infos->infos.data()] = std::move(infos);
    _kernelArrays[sites->sites.data()] = std::move(sites);
    return _log(call);
}

VSReturnCode VSFakePlatform::release_memory(const void *address, uint64_t length) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::ReleaseMemory, -1, reinterpret_cast<uintptr_t>(address), length, 0, 0};
    if (auto failure = _enter(VSFakeQuery::ReleaseMemory, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    auto it = _kernelArrays.find(address);
    if (it == _kernelArrays.end() || it->second->length != length) {
        call.result = vs::kReturnInvalidArgument;
        return _log(call);
    }
    _kernelArrays.erase(it);
    return _log(call);
}

std::map<std::string, VSKextInfo> VSFakePlatform::loaded_kext_info() {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::LoadedKextInfo, -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::LoadedKextInfo, nullptr)) {
        call.result = *failure;
        _log(call);
        return {};
    }
    _log(call);
    return _kexts;
}

std::unique_ptr<VSKernelSymbolicator> VSFakePlatform::kernel_symbolicator() {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::KernelSymbolicator, -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::KernelSymbolicator, nullptr)) {
        call.result = *failure;
        _log(call);
        return nullptr;
    }
    _log(call);
    return std::make_unique<VSFakeKernelSymbolicatorImpl>(_kernelSymbols);
}

// ---- the fake: own task --------------------------------------------------------------------------

VSReturnCode VSFakePlatform::ports_lookup(std::vector<uint32_t> &ports) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::PortsLookup, -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::PortsLookup, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    ports = _ports;
    return _log(call);
}

int32_t VSFakePlatform::sysctl_by_name_read(std::string_view name, int32_t &value) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::SysctlByNameRead, -1, 0, 0, 0, 0};
    if (auto failure = _enter(VSFakeQuery::SysctlByNameRead, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    auto it = _settings.find(name);
    if (it == _settings.end()) {
        call.result = kErrnoNoEntry;
        return _log(call);
    }
    value = it->second;
    return _log(call);
}

int32_t VSFakePlatform::sysctl_by_name_write(std::string_view name, int32_t value) {
    std::lock_guard lock(_mutex);
    VSFakeCall call{VSFakeQuery::SysctlByNameWrite, -1, 0, 0, 0, 0};
    _settingWrites.emplace_back(std::string(name), value);
    if (auto failure = _enter(VSFakeQuery::SysctlByNameWrite, nullptr)) {
        call.result = *failure;
        return _log(call);
    }
    auto it = _settings.find(name);
    if (it == _settings.end()) {
        call.result = kErrnoNoEntry;
        return _log(call);
    }
    it->second = value;
    return _log(call);
}

int32_t VSFakePlatform::own_pid() {
    std::lock_guard lock(_mutex);
    return _ownPid;
}

uint32_t VSFakePlatform::effective_user_id() {
    std::lock_guard lock(_mutex);
    return _effectiveUserId;
}
