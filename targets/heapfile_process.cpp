#include "targets/heapfile_process.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <limits>
#include <optional>

#include "model/assert.h"
#include "model/image.h"
#include "targets/platform/files.h"

namespace {

constexpr int64_t kErrorUnknownInitialization = 1;
constexpr int64_t kErrorUnknownPlatform = 2;

// Record counters are 32-bit; a count that does not fit is held at the top
// rather than wrapped into a small one.
uint32_t saturated(uint64_t value) {
    return value > std::numeric_limits<uint32_t>::max() ? std::numeric_limits<uint32_t>::max()
                                                        : static_cast<uint32_t>(value);
}

}  // namespace

namespace vs {

std::optional<std::string> readWholeFile(const std::string &path, HeapfileError *error) {
    FileFailure failure;
    std::optional<std::string> bytes = readRegularFile(path, kMaxHeapfileSize, failure);
    if (!bytes && error != nullptr) {
        *error = {std::string(kPosixErrorDomain), failure.error, failure.reason};
    }
    return bytes;
}

}  // namespace vs

std::unique_ptr<VSHeapfileProcess> VSHeapfileProcess::processWithHeapfile(const std::string &path,
                                                                          vs::HeapfileError *error) {
    auto process = std::make_unique<VSHeapfileProcess>();
    if (!process->initWithHeapfile(path, error)) {
        return nullptr;
    }
    return process;
}

bool VSHeapfileProcess::initWithHeapfile(const std::string &path, vs::HeapfileError *error) {
    std::optional<std::string> bytes = vs::readWholeFile(path, error);
    if (!bytes) {
        return false;
    }
    vs::HeapfileError scratch;
    std::unique_ptr<VSHeapfileReader> reader = VSHeapfileReader::openFromData(*bytes, &scratch);
    _graph = std::move(reader);
    if (!_graph) {
        if (error != nullptr) {
            *error = scratch.description.empty()
                         ? vs::HeapfileError{std::string(vs::kVestageErrorDomain), kErrorUnknownInitialization,
                                             "heapfile initialization failed with unknown error"}
                         : scratch;
        }
        return false;
    }
    // The file's bytes are not needed once the reader holds the document.
    bytes.reset();

    // The inherited set-up runs on a record made from the file: the hooks
    // (page size, task, physical vestage) answer from the reader.
    VSBsdInfo info;
    info.flags = _graph->is64bit() ? vs::kBsdInfoFlag64Bit : 0;
    info.pid = static_cast<uint32_t>(_graph->pid());
    if (!initWithBsdInfo(info)) {
        return false;
    }
    setName(_graph->processName());
    setDisplayString(name() + " [" + std::to_string(pid()) + "] (heapfile)");

    // The recorded platform, not the pointer width, places the shared
    // cache region.
    const uint64_t platform = vs::platformCodeForHeapfileDescription(_graph->processDescription());
    if (!_setSharedRegionFromPlatform(platform)) {
        if (error != nullptr) {
            *error = {std::string(vs::kVestageErrorDomain), kErrorUnknownPlatform,
                      "Unable to determine platform from memory graph process description"};
        }
        return false;
    }
    // The inherited set-up asked the live system about this pid; a recorded
    // process has no idle-exit state.
    _setIdleExitStatus(VSIdleExitUnknown);
    _anonymousDirtyRecalculation = false;
    return true;
}

bool VSHeapfileProcess::breakDownPhysVestage() const { return _graph && _graph->breakDownPhysVestage(); }

uint64_t VSHeapfileProcess::_gatherPageSize() { return _graph ? _graph->pageSize() : 0; }

void VSHeapfileProcess::_gatherPhysVestage() {
    if (!_graph) {
        return;
    }
    _phys_vestage = _graph->physVestage();
    _phys_vestage_peak = _graph->physVestagePeak();
}

VSRegionInfo VSHeapfileProcess::_regionInfoForHeapfileRegion(const VSHeapfileRegion &region) const {
    VSRegionInfo info;
    info.protection = region.protection;
    info.maxProtection = region.maxProtection;
    info.userTag = region.userTag;
    // Inside the shared cache region the counters carry bytes: its pieces
    // are cut at image boundaries that need not fall on pages, and they
    // take their sizes from here instead of page queries.
    const bool inSharedRegion = _sharedRegionSize != 0 && region.address >= _sharedRegionBase &&
                                region.address - _sharedRegionBase < _sharedRegionSize;
    const uint64_t page = pageSize();
    auto counter = [&](uint64_t bytes) -> uint32_t {
        if (inSharedRegion) {
            return saturated(bytes);
        }
        return page == 0 ? 0 : saturated(bytes / page);
    };
    info.residentPages = counter(region.residentBytes);
    info.sharedNowPrivatePages = counter(region.sharedNowPrivateBytes);
    info.swappedOutPages = counter(region.swappedBytes);
    info.dirtiedPages = counter(region.dirtyBytes);
    info.referenceCount = region.referenceCount;
    info.externalPager = region.externalPager;
    info.shareMode = region.shareMode;
    info.isSubmap = region.submap & 1;
    info.objectId = static_cast<uint32_t>(region.objectId);
    info.offset = region.offset;
    return info;
}

void VSHeapfileProcess::enumerateRegions(const RegionCallback &callback) {
    if (!_graph) {
        return;
    }
    // One image in the making: a region's type is tried as a segment name,
    // and the image is kept only when the name is one.
    std::optional<VSImage> scratch;
    _graph->enumerateRegions([&](const VSHeapfileRegion &region, bool &stop) {
        VSRegionInfo info = _regionInfoForHeapfileRegion(region);
        if (!scratch) {
            scratch.emplace();
        }
        scratch->setName(region.type);
        if (scratch->segment() != VSSegmentUnknown) {
            // Appended just before its own region reaches the callback, so
            // the callback's image lookup finds exactly this image.
            scratch->setStart(region.address);
            scratch->setSize(region.length);
            scratch->setOwnerPath(region.path);
            _images.push_back(std::move(*scratch));
            scratch.reset();
        }
        // A file's pages show its path; so do the copies a private mapping
        // made of them, which the capture wrote as a mapped file too.
        const bool showsPath = region.externalPager != 0 || region.type == "mapped file" ||
                               vs::isNamedSharedMemoryTag(info.userTag);
        const std::optional<std::string> path = showsPath ? region.path : std::nullopt;
        stop = callback(region.address, region.length, info, region.purgeableState, path);
    });
}

bool VSHeapfileProcess::_populateMemoryRegionWithPageQueries(VSMemoryRegion &region, const VSRegionInfo &info) {
    VS_ASSERT_MSG(region.dirtySize() == 0, "memoryRegion.dirtySize == 0");
    VS_ASSERT_MSG(region.swappedSize() == 0, "memoryRegion.swappedSize == 0");
    region.setDirtySize(info.dirtiedPages);
    region.setSwappedSize(info.swappedOutPages);
    return true;
}
