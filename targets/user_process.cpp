#include "targets/user_process.h"

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <mutex>
#include <span>
#include <system_error>
#include <unordered_map>
#include <utility>

#include "model/assert.h"

namespace {

constexpr uint32_t kAllOnesTag = 0xFFFFFFFFu;
constexpr uint64_t kBisectionResolution = 0x1000000;  // 16 MiB
constexpr uint32_t kSharedCacheAlignment = 4096;

const char *const kUnusedSharedCacheName = "unused rtloader shared cache area";
const char *const kLinkeditSharedCacheName = "__LINKEDIT rtloader shared cache";
const char *const kUntaggedName = "untagged (\"VM_ALLOCATE\")";

struct SharedRegionLayout {
    uint64_t code;
    uint64_t base;
    uint64_t size;
};

constexpr SharedRegionLayout kSharedRegionLayouts[] = {
    {VSPlatformX86, 0x90000000, 0x20000000},
    {VSPlatformX86_64, 0x7FFF00000000, 0xFFE00000},
    {VSPlatformARM, 0x1A000000, 0x26000000},
    {VSPlatformARM64, 0x180000000, 0x100000000},
    {VSPlatformARM64_32, 0x1A000000, 0x26000000},
    {VSPlatformNone, 0, 0},
};

uint64_t roundUp(uint64_t value, uint64_t multiple) {
    const uint64_t remainder = value % multiple;
    return remainder == 0 ? value : value + (multiple - remainder);
}

// "a b" from two texts that may be absent (shown as the empty text).
std::string joined(const std::optional<std::string> &first, const std::optional<std::string> &second) {
    return first.value_or("") + " " + second.value_or("");
}

// Owner paths are shown with symbolic links resolved; a path that cannot be
// resolved (gone, or in another mount namespace) is shown as reported.
// Resolving asks the file system about every component of the path, and
// every process of a run maps the same few libraries: each path is resolved
// once per run.
std::string resolvedPath(const std::string &path) {
    static std::mutex lock;
    static std::unordered_map<std::string, std::string> resolvedPaths;
    {
        std::lock_guard<std::mutex> guard(lock);
        if (auto found = resolvedPaths.find(path); found != resolvedPaths.end()) {
            return found->second;
        }
    }
    std::error_code error;
    std::filesystem::path resolved = std::filesystem::weakly_canonical(path, error);
    std::string result = (error || resolved.empty()) ? path : resolved.string();
    std::lock_guard<std::mutex> guard(lock);
    return resolvedPaths.try_emplace(path, std::move(result)).first->second;
}

}  // namespace

VSUserProcess::~VSUserProcess() {
    // A target that outlives its platform (a test that uninstalled it) has
    // nothing left to give the handle back to.
    VSPlatform *platform = VSPlatform::installed();
    if (_ownsTask && _task != vs::kTaskHandleNone && platform != nullptr) {
        platform->release_task_handle(_task);
    }
}

// ---- set-up -----------------------------------------------------------------------

bool VSUserProcess::initWithBsdInfo(const VSBsdInfo &info) {
    _anonymousDirtyRecalculation = true;
    if (!VSProcess::initWithBsdInfo(info)) {
        return false;
    }
    // The platform knows where (and whether) a target has a shared cache
    // region; the result is not needed, a failure leaves no region.
    _setSharedRegionFromPlatform(VSPlatform::current().target_platform_code(pid(), is64bit()));
    _images.clear();
    _gatherKernelMemory();
    _gatherPhysVestage();
    _gatherIdleExitStatus();
    _sharedRegionAlignmentSize = kSharedCacheAlignment;
    return true;
}

bool VSUserProcess::_populateTask() {
    VSPlatform &platform = VSPlatform::current();
    VSTaskHandle task = vs::kTaskHandleNone;
    const VSReturnCode code = platform.task_handle_for_pid(pid(), task);
    if (code != vs::kReturnSuccess) {
        platform.report_error_code("task_handle_for_pid", code);
        _addGlobalError("task_handle_for_pid [" + std::to_string(pid()) + "] " + platform.error_text(code));
        VSResourceUsageInfo usage;
        if (platform.pid_resource_usage(pid(), vs::kResourceUsageVersion4, usage) == 0) {
            _addUncountedResident(usage.residentSize);
        }
        return false;
    }
    _task = task;
    _ownsTask = true;
    return true;
}

bool VSUserProcess::_setSharedRegionFromPlatform(uint64_t platformCode) {
    for (const SharedRegionLayout &layout : kSharedRegionLayouts) {
        if (layout.code == platformCode) {
            _sharedRegionBase = layout.base;
            _sharedRegionSize = layout.size;
            return true;
        }
    }
    std::fputs("Unable to determine platform architecture of target\n", stderr);
    return false;
}

void VSUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags) {
    constexpr uint32_t kSupportsIdleExit = vs::kDirtyFlagTracked | vs::kDirtyFlagAllowIdleExit;
    if ((flags & kSupportsIdleExit) != kSupportsIdleExit) {
        _setIdleExitStatus(VSIdleExitUnsupported);
    } else if ((flags & vs::kDirtyFlagIsDirty) != 0) {
        _setIdleExitStatus(VSIdleExitDirty);
    } else {
        _setIdleExitStatus(VSIdleExitClean);
    }
}

void VSUserProcess::_gatherIdleExitStatus() {
    uint32_t flags = 0;
    VSPlatform::current().pid_dirty_flags(pid(), flags);  // a failure leaves 0: unsupported
    _setIdleExitStatusFromDirtyFlags(flags);
}

void VSUserProcess::_gatherKernelMemory() {
    VSTaskKernelMemoryInfo info;
    uint32_t count = vs::kTaskKernelMemoryInfoCount;
    if (VSPlatform::current().task_memory_info(_task, info, count) != vs::kReturnSuccess) {
        return;
    }
    // Differences are reported as signed values, also a negative one from a
    // counter that ran backwards.
    _kprvt = static_cast<int64_t>(info.privateAllocated - info.privateFreed);
    _kshrd = static_cast<int64_t>(info.sharedAllocated - info.sharedFreed);
}

void VSUserProcess::_gatherPhysVestage() {
    if (!_isAlive()) {
        return;
    }
    VSResourceUsageInfo usage;
    if (VSPlatform::current().pid_resource_usage(pid(), vs::kResourceUsageVersion4, usage) != 0) {
        return;
    }
    _phys_vestage = usage.physVestage;
    _phys_vestage_peak = usage.lifetimeMaxPhysVestage;
}

std::shared_ptr<const VSAuxDataDictionary> VSUserProcess::auxData() const {
    VSAuxDataDictionary::Entries entries;
    if (_phys_vestage != 0) {
        entries["phys_vestage"] = vs::makeAuxData(static_cast<int64_t>(_phys_vestage), false);
        entries["phys_vestage_peak"] = vs::makeAuxData(static_cast<int64_t>(_phys_vestage_peak), false);
    }
    if (_isAlive()) {
        entries["Kernel memory"] = vs::makeAuxDictionary({
            {"KPRVT", vs::makeAuxData(_kprvt, true)},
            {"KSHRD", vs::makeAuxData(_kshrd, true)},
        });
    }
    if (entries.empty()) {
        return nullptr;
    }
    return vs::makeAuxDictionary(std::move(entries));
}

// ---- gathering ----------------------------------------------------------------------

bool VSUserProcess::prepareGatherData() {
    return _isAlive() && _task != vs::kTaskHandleNone && VSPlatform::current().prepare_task_walk(_task);
}

void VSUserProcess::gatherData() {
    _gatherImageData();
    _gatherMemoryData();
}

void VSUserProcess::_gatherImageData() {
    const auto loaded = VSPlatform::current().symbolicator(_task, vs::kSymbolicatorImagesOnly);
    for (const VSSymbolicatorImage &image : loaded) {
        const std::string ownerPath = resolvedPath(image.path);
        for (const VSSymbolicatorSegment &segment : image.segments) {
            // An empty segment covers no address; the cutting of the shared
            // cache could not step past it.
            if (segment.length == 0) {
                continue;
            }
            VSImage entry;
            entry.setStart(segment.start);
            entry.setSize(segment.length);
            if (segment.name == VSPlatform::image_header_segment_name) {
                entry.setName(std::string("__TEXT"));
            } else {
                // The format's own name, cut at its first blank (a name
                // without one is taken whole).
                entry.setName(segment.name.substr(0, segment.name.find(' ')));
            }
            entry.setOwnerPath(ownerPath);
            _images.push_back(std::move(entry));
        }
    }
    std::stable_sort(_images.begin(), _images.end(),
                     [](const VSImage &a, const VSImage &b) { return a.start() < b.start(); });
}

void VSUserProcess::_gatherMemoryData() {
    VSImageEnumerator images(_images);
    VSMemoryRegionList regions;
    const bool breakDown = breakDownPhysVestage();
    _cachedDispositionAddress = 0;
    _cachedDisposition = 0;
    _hasCachedDisposition = false;
    _pendingUnusedSharedRegion = nullptr;

    // Region names repeat: each distinct one is made a shared string once
    // per walk (per image, per tag), not once per region.
    const std::string *const mappedFileName = vs::internedString("mapped file");
    std::unordered_map<const VSImage *, std::pair<const std::string *, const std::string *>> imageNames;
    std::unordered_map<uint64_t, const std::string *> tagNames;

    const uint64_t sharedEnd = _sharedRegionBase + _sharedRegionSize;
    enumerateRegions([&](uint64_t start, uint64_t size, VSRegionInfo &info, int32_t purgeableState,
                         const std::optional<std::string> &path) {
        if (_sharedRegionSize != 0 && start >= _sharedRegionBase && start < sharedEnd) {
            if (_addRegionsToArray(regions, start, size, info, images)) {
                return false;
            }
            std::fprintf(stderr, "bailing out for process %s; data may be incomplete!\n", displayString().c_str());
            return true;
        }

        auto region = std::make_unique<VSMemoryRegion>();
        region->setStart(start);
        region->setSize(size);
        region->setUser_tag(info.userTag);
        region->setObject_id(info.objectId);
        region->setShare_mode(info.shareMode);
        region->setOffset(info.offset);
        region->setInSharedCache(false);
        _applyRecordRules(*region, info, purgeableState, breakDown);
        region->setSegment(VSSegmentNone);

        if (const VSImage *image = images.nextImageForStart(start, start + size)) {
            auto [names, added] = imageNames.try_emplace(image);
            if (added) {
                names->second.first = vs::internedString(joined(image->name(), image->ownerPath()));
                names->second.second = image->ownerPath() ? vs::internedString(*image->ownerPath()) : nullptr;
            }
            region->setSharedName(names->second.first);
            region->setSharedDetailedName(names->second.second);
            region->setSegment(image->segment());
        } else if (path && vs::isNamedSharedMemoryTag(info.userTag)) {
            region->setSharedName(vs::internedString(VSMemoryRegion::sharedMemoryCategoryName(*path)));
            region->setSharedDetailedName(vs::internedString(*path));
        } else if (path || info.externalPager != 0) {
            region->setSharedName(mappedFileName);
            region->setSharedDetailedName(path ? vs::internedString(*path) : nullptr);
        } else {
            const bool purgeableNonVolatile = purgeableState == VSPurgeableNonVolatile && breakDown;
            const uint64_t key = (uint64_t{info.userTag} << 1) | (purgeableNonVolatile ? 1 : 0);
            auto [name, added] = tagNames.try_emplace(key, nullptr);
            if (added) {
                std::optional<std::string> text = VSMemoryRegion::categoryNameForTag(info.userTag);
                if (!text || text->empty()) {
                    text = kUntaggedName;
                }
                if (purgeableNonVolatile) {
                    *text += " (purgeable non-volatile)";
                }
                name->second = vs::internedString(*text);
            }
            region->setPurgeableNonVolatile(purgeableNonVolatile);
            region->setSharedName(name->second);
        }
        regions.push_back(std::move(region));
        return false;
    });

    _pendingUnusedSharedRegion = nullptr;
    setMemoryRegions(std::move(regions));
}

// ---- the walk -----------------------------------------------------------------------

uint64_t VSUserProcess::_lastNonSharedCacheRegion() {
    if (_sharedRegionSize == 0) {
        return 0;
    }
    VSPlatform &platform = VSPlatform::current();
    const uint64_t page = pageSize();
    uint64_t lo = 0;
    uint64_t hi = _sharedRegionBase;
    do {
        const uint64_t mid = lo / 2 + hi / 2;
        uint64_t address = mid;
        uint64_t size = 0;
        VSRegionBasicInfo info;
        uint32_t count = vs::kRegionBasicInfoCount;
        uint32_t objectName = 0;
        const VSReturnCode code =
            platform.region_info(_task, address, size, vs::kRegionBasicInfoFlavor, info, count, objectName);
        if (code != vs::kReturnSuccess || address == lo) {
            return lo;
        }
        if (address < _sharedRegionBase) {
            lo = address;
        } else {
            // A region that ends within the first page would leave hi below
            // lo; the loop condition then ends the search.
            hi = mid >= page ? mid - page : 0;
        }
    } while (hi > lo && hi - lo > kBisectionResolution);
    return lo;
}

void VSUserProcess::_walkFailed(const char *label, VSReturnCode code) {
    VSPlatform::current().report_error_code(label, code);
    std::fprintf(stderr, "bailing out for process %s; data may be incomplete!\n", displayString().c_str());
    _processMachVMError(code, vs::kReturnDeadPort);
}

void VSUserProcess::enumerateRegions(const RegionCallback &callback) {
    VSPlatform &platform = VSPlatform::current();
    const bool hasSharedRegion = _sharedRegionSize != 0;
    const uint64_t sharedEnd = _sharedRegionBase + _sharedRegionSize;
    uint64_t address = 0;
    uint64_t size = 0;
    bool seenAllOnesTag = false;
    // Below L the top-level map is not asked. When the bisection found
    // nothing (L = 0) it is asked from the bottom up, so that the record of
    // the shared cache range always comes from a query of the current
    // address and never from the iteration before.
    const uint64_t lastBelowSharedCache = _lastNonSharedCacheRegion();
    std::vector<VSRegionInfo> parts;

    while (true) {
        VSRegionInfo info;
        int32_t purgeableState = VSPurgeableDeny;
        std::optional<std::string> path;

        if (hasSharedRegion && address >= lastBelowSharedCache && address < sharedEnd) {
            uint64_t reported = address;
            VSRegionBasicInfo basic;
            uint32_t count = vs::kRegionBasicInfoCount;
            uint32_t objectName = 0;
            const VSReturnCode code =
                platform.region_info(_task, reported, size, vs::kRegionBasicInfoFlavor, basic, count, objectName);
            if (code == vs::kReturnNoMoreRegions) {
                return;
            }
            if (code != vs::kReturnSuccess) {
                _walkFailed("region_info", code);
                return;
            }
            if (reported >= address) {
                address = reported;
            }
            if (address >= _sharedRegionBase && address < sharedEnd) {
                // The shared cache region as one range of the top-level map.
                info.protection = basic.protection;
                info.maxProtection = basic.maxProtection;
                info.inheritance = basic.inheritance;
                info.offset = basic.offset;
                info.behaviour = basic.behaviour;
                info.userWiredCount = basic.userWiredCount;
                info.externalPager = 1;
                info.shareMode = vs::kShareModeCopyOnWrite;
                info.isSubmap = 0;
                info.objectId = 1;
                if (callback(address, size, info, purgeableState, path)) {
                    return;
                }
                if (address + size <= address) {
                    return;  // the range reaches the top of the address space
                }
                address += size;
                continue;
            }
        }

        uint64_t reported = address;
        uint32_t depth = vs::kUnlimitedDepth;
        uint32_t count = vs::kRegionInfoCount;
        const VSReturnCode code = platform.region_recurse(_task, reported, size, depth, info, count);
        if (code == vs::kReturnNoMoreRegions) {
            return;
        }
        if (code != vs::kReturnSuccess) {
            _walkFailed("region_recurse", code);
            return;
        }
        // What an all-ones tag stands for is not known; it marks the end of
        // what is worth walking once another tag follows it.
        if (seenAllOnesTag && info.userTag != kAllOnesTag) {
            return;
        }
        address = reported;

        int32_t state = VSPurgeableDeny;
        if (platform.purgeable_control(_task, address, vs::kPurgeableGetState, state) == vs::kReturnSuccess) {
            purgeableState = state;
        }
        VS_ASSERT(info.isSubmap == 0);
        if (info.userTag == kAllOnesTag) {
            seenAllOnesTag = true;
        }
        if ((info.externalPager != 0 || vs::isNamedSharedMemoryTag(info.userTag)) && _isAlive()) {
            char buffer[vs::kRegionFilenameBufferSize];
            const int32_t length = platform.pid_region_filename(pid(), address, buffer);
            if (length > 0) {
                path.emplace(buffer, std::min<size_t>(static_cast<size_t>(length), sizeof(buffer)));
            }
        }
        if (callback(address, size, info, purgeableState, path)) {
            return;
        }
        // The other memory objects the same mapping holds pages of, each a
        // region over the same range.
        if (platform.region_parts(_task, address, parts) == vs::kReturnSuccess) {
            for (size_t i = 1; i < parts.size(); ++i) {
                if (callback(address, size, parts[i], purgeableState, path)) {
                    return;
                }
            }
        }
        if (address + size <= address) {
            return;  // an empty region or one reaching the top: nothing follows
        }
        address += size;
    }
}

void VSUserProcess::_processMachVMError(VSReturnCode code, VSReturnCode expectedOnExit) {
    VSPlatform &platform = VSPlatform::current();
    std::string suffix;
    bool gone = false;
    if (code == expectedOnExit && _isAlive()) {
        VSShortInfo info;
        int32_t errorNumber = 0;
        if (platform.pid_short_info(pid(), info, errorNumber) != static_cast<int32_t>(sizeof(VSShortInfo))) {
            if (errorNumber == vs::kErrorNoSuchProcess) {
                suffix = " (process exited)";
                gone = true;
            }
        } else if (info.runStatus == vs::kRunStatusZombie) {
            suffix = " (zombie)";
            gone = true;
        }
    }
    std::string text = displayString() + ": " + platform.error_text(code) + suffix;
    if (gone) {
        _addWarning(std::move(text));
    } else {
        _addError(std::move(text));
    }
}

bool VSUserProcess::_addRegionsToArray(VSMemoryRegionList &regions, uint64_t start, uint64_t size,
                                       const VSRegionInfo &info, VSImageEnumerator &images) {
    const uint64_t end = start + size;
    const uint64_t page = pageSize();
    const uint64_t alignment = _sharedRegionAlignmentSize;

    auto makePiece = [&](uint64_t pieceStart, uint64_t pieceEnd) {
        auto piece = std::make_unique<VSMemoryRegion>();
        piece->setStart(pieceStart);
        piece->setEnd(pieceEnd);
        piece->setUser_tag(info.userTag);
        piece->setObject_id(info.objectId);
        piece->setShare_mode(info.shareMode);
        piece->setOffset(info.offset - start + pieceStart);
        piece->setInSharedCache(true);
        return piece;
    };

    uint64_t cursor = start;
    const VSImage *image = images.nextImageForStart(start, end);
    while (cursor < end) {
        if (image == nullptr || cursor < image->start()) {
            const uint64_t gapEnd = image == nullptr ? end : std::min(image->start(), end);
            auto gap = makePiece(cursor, gapEnd);
            gap->setName(std::string(kUnusedSharedCacheName));
            gap->setUnusedSharedCacheRegion(true);
            // Only an area with a partial page can take a share of a page a
            // neighbour queries.
            if (page != 0 && (cursor % page != 0 || gapEnd % page != 0)) {
                if (!_populateMemoryRegionWithPageQueries(*gap, info)) {
                    return false;
                }
            }
            regions.push_back(std::move(gap));
            cursor = gapEnd;
            if (cursor >= end || image == nullptr) {
                break;
            }
        }

        const uint64_t pieceStart = std::max(image->start(), cursor);
        uint64_t pieceEnd = std::min(image->end(), end);
        const VSImage *next = images.nextImageForStart(pieceEnd, end);
        if (next != image && alignment != 0 && pieceStart % alignment == 0 &&
            (next == nullptr || next->start() % alignment == 0)) {
            // A gap shorter than the alignment is padding of this segment.
            // The piece never grows past the range, whose rest belongs to the
            // regions walked after it.
            pieceEnd = std::min(roundUp(pieceEnd, alignment), end);
        }
        auto piece = makePiece(pieceStart, pieceEnd);
        const VSSegmentKind kind = image->segment();
        if (kind == VSSegmentLinkedit) {
            piece->setName(std::string(kLinkeditSharedCacheName));
        } else {
            piece->setName(joined(image->name(), image->ownerPath()));
        }
        piece->setSegment(kind);
        if (kind != VSSegmentText && kind != VSSegmentLinkedit) {
            if (!_populateMemoryRegionWithPageQueries(*piece, info)) {
                return false;
            }
        }
        piece->setWiredSize(std::min(page * info.userWiredCount, piece->dirtySize()));
        regions.push_back(std::move(piece));
        if (next == image && pieceEnd < end) {
            break;  // cannot happen with non-empty images; never loop on one
        }
        cursor = pieceEnd;
        image = next;
    }
    return true;
}

// ---- page classification ------------------------------------------------------------

void VSUserProcess::_applyRecordRules(VSMemoryRegion &region, const VSRegionInfo &info, int32_t purgeableState,
                                      bool breakDown) const {
    const uint64_t page = pageSize();
    region.setWiredSize(page * info.userWiredCount);
    switch (purgeableState) {
    case VSPurgeableEmpty:
        region.setDirtySize(0);
        region.setReclaimableSize(region.size());
        region.setSwappedSize(0);
        region.setCleanNonSpecSize(0);
        return;
    case VSPurgeableVolatile:
        region.setDirtySize(0);
        region.setReclaimableSize(page * info.residentPages);
        region.setSwappedSize(0);
        region.setCleanNonSpecSize(0);
        return;
    default:
        break;
    }
    // Counters are read from one moment of a changing process and need not
    // add up: reusable pages can outnumber resident ones, and dirtied plus
    // reusable pages can exceed the resident ones. Differences stop at 0
    // instead of wrapping into absurd sizes.
    const uint64_t resident = info.residentPages;
    const uint64_t reusable = info.reusablePages;
    uint64_t dirty = info.dirtiedPages;
    if (info.externalPager == 0 && _anonymousDirtyRecalculation && !breakDown) {
        dirty = resident > reusable ? resident - reusable : 0;
    }
    const uint64_t accounted = dirty + reusable;
    region.setDirtySize(page * dirty);
    region.setReclaimableSize(page * reusable);
    region.setSwappedSize(page * static_cast<uint64_t>(info.swappedOutPages));
    region.setCleanNonSpecSize(resident > accounted ? page * (resident - accounted) : 0);
}

namespace {

bool countsAsDirty(int32_t word) {
    return (word & vs::kPageDispositionDirty) != 0 ||
           (word & (vs::kPageDispositionPresent | vs::kPageDispositionExternal)) == vs::kPageDispositionPresent;
}

}  // namespace

void VSUserProcess::_classifyPages(VSMemoryRegion &region, uint64_t pageCount, VSMemoryRegion *nextPending) {
    const uint64_t page = pageSize();
    const uint64_t s = region.start();
    const uint64_t e = region.end();
    const uint64_t a = s - s % page;
    const uint64_t b = roundUp(e, page);
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    for (uint64_t i = 0; i < pageCount; ++i) {
        const int32_t word = _dispositions[i];
        const bool isDirty = countsAsDirty(word);
        const bool isSwapped = !isDirty && (word & vs::kPageDispositionPagedOut) != 0;
        if (!isDirty && !isSwapped) {
            continue;
        }
        const int32_t remembered = (isDirty ? vs::kPageDispositionDirty : 0) | (word & vs::kPageDispositionPagedOut);
        uint64_t length = page;
        if (i == 0 && (s % page != 0 || pageCount == 1)) {
            length = std::min(region.size(), a + page - s);
            _cachedDispositionAddress = a;
            _cachedDisposition = remembered;
            _hasCachedDisposition = true;
            if (VSMemoryRegion *pending = _pendingUnusedSharedRegion) {
                // The unused area gets its own bytes of this page. When it
                // does not reach into this page (an unclassified text or
                // link-edit piece lay between), its last page was never
                // queried and it gets nothing.
                const uint64_t pendingEnd = pending->end();
                if (pendingEnd > a && pendingEnd <= s) {
                    const uint64_t share = std::min(pending->size(), pendingEnd - a);
                    if (isDirty) {
                        pending->setDirtySize(pending->dirtySize() + share);
                    } else {
                        pending->setSwappedSize(pending->swappedSize() + share);
                    }
                }
                _pendingUnusedSharedRegion = nullptr;
            }
        } else if (i == pageCount - 1 && e % page != 0) {
            _cachedDispositionAddress = b - page;
            _cachedDisposition = remembered;
            _hasCachedDisposition = true;
            length = e - (b - page);
        }
        if (isDirty) {
            dirty += length;
        } else {
            swapped += length;
        }
    }
    region.setSwappedSize(swapped);
    region.setDirtySize(dirty);
    _pendingUnusedSharedRegion = nextPending;
}

bool VSUserProcess::_populateMemoryRegionWithPageQueries(VSMemoryRegion &region, const VSRegionInfo &) {
    const uint64_t page = pageSize();
    const bool unused = region.unusedSharedCacheRegion();
    if (page == 0) {
        // No pages to speak of.
        if (!unused) {
            region.setDirtySize(0);
            region.setSwappedSize(0);
        }
        _pendingUnusedSharedRegion = nullptr;
        return true;
    }
    const uint64_t s = region.start();
    const uint64_t e = region.end();
    const uint64_t a = s - s % page;
    const uint64_t b = roundUp(e, page);
    const uint64_t n = (b - a) / page;

    // One word per page, kept between regions so that a large piece does
    // not need a fresh buffer (and never a stack frame of its size).
    _dispositions.assign(n, 0);
    uint64_t queryStart = a;
    uint64_t queryCount = n;
    uint64_t firstSlot = 0;
    const bool firstPageKnown = n > 0 && _hasCachedDisposition && a == _cachedDispositionAddress;
    if (firstPageKnown) {
        _dispositions[0] = _cachedDisposition;
        queryStart = a + page;
        queryCount = n - 1;
        firstSlot = 1;
    }

    if (!unused) {
        if (queryCount > 0) {
            VSPlatform &platform = VSPlatform::current();
            uint64_t count = queryCount;
            const VSReturnCode code = platform.page_range_query(
                _task, queryStart, b - queryStart, std::span<int32_t>(_dispositions).subspan(firstSlot, queryCount),
                count);
            if (code != vs::kReturnSuccess) {
                platform.report_error_code("page_range_query", code);
                _processMachVMError(code, vs::kReturnInvalidArgument);
                return false;
            }
        }
        if (n == 0) {
            region.setDirtySize(0);
            region.setSwappedSize(0);
            _pendingUnusedSharedRegion = nullptr;
            return true;
        }
        _classifyPages(region, n, nullptr);
        return true;
    }

    // An unused area is never queried: it only takes its share of a page
    // that a neighbour has already classified.
    VSMemoryRegion *nextPending = (n >= 2 && e % page != 0) ? &region : nullptr;
    if (s % page != 0 && firstPageKnown) {
        _classifyPages(region, 1, nextPending);
        return true;
    }
    _pendingUnusedSharedRegion = nextPending;
    return true;
}
