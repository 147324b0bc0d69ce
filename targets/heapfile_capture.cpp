#include "targets/heapfile_capture.h"

#include "targets/platform/files.h"

#include <algorithm>
#include <cstdio>
#include <random>
#include <vector>

#include "model/image.h"
#include "model/memory_region.h"
#include "targets/user_process.h"

namespace {

uint64_t fnv1a(std::string_view text) {
    uint64_t hash = 0xcbf29ce484222325ull;
    for (unsigned char c : text) {
        hash ^= c;
        hash *= 0x100000001b3ull;
    }
    return hash;
}

// The heapfile walk keeps 32 bits of an object id, and 0 means "no object".
uint64_t objectIdForIdentity(std::string_view identity) {
    const uint64_t hash = fnv1a(identity);
    const uint64_t folded = (hash ^ (hash >> 32)) & 0xFFFFFFFFull;
    return folded == 0 ? 1 : folded;
}

// The architecture named in a snapshot's description: the heapfile reader
// tells platforms apart by these names.
const char *architectureName(bool is64bit) {
#if defined(__x86_64__) || defined(__i386__)
    return is64bit ? "X86-64" : "X86";
#elif defined(__aarch64__) || defined(__arm__)
    return is64bit ? "ARM64" : "ARM";
#else
    return is64bit ? "64-bit" : "32-bit";
#endif
}

// Whether a type text would make the heapfile walk build an image.
bool namesSegment(const std::string &type) {
    VSImage probe;
    probe.setName(type);
    return probe.segment() != VSSegmentUnknown;
}

// A live process gathered the usual way, recording what its walk sees.
class VSCapturingProcess : public VSUserProcess {
public:
    struct WalkedRegion {
        uint64_t start = 0;
        uint64_t size = 0;
        VSRegionInfo info;
        int32_t purgeableState = VSPurgeableDeny;
        std::optional<std::string> path;
        const VSImage *image = nullptr;  // into _images, which no longer changes
    };

    ~VSCapturingProcess() override {
        if (_ownsCaptureTask && _task != vs::kTaskHandleNone) {
            VSPlatform::current().release_task_handle(_task);
            _task = vs::kTaskHandleNone;
        }
    }

    bool setUp(const VSBsdInfo &info) { return initWithBsdInfo(info); }

    const std::vector<WalkedRegion> &walked() const { return _walked; }
    const std::optional<std::string> &taskError() const { return _taskError; }
    bool breakDownDuringWalk() const { return _breakDown; }

protected:
    // Opens the task without the live run's report: a capture tells the
    // user itself which pid it could not read.
    bool _populateTask() override {
        VSPlatform &platform = VSPlatform::current();
        VSTaskHandle task = vs::kTaskHandleNone;
        const VSReturnCode code = platform.task_handle_for_pid(pid(), task);
        if (code != vs::kReturnSuccess) {
            _taskError = platform.error_text(code);
            return false;
        }
        _task = task;
        _ownsCaptureTask = true;
        return true;
    }

    void enumerateRegions(const RegionCallback &callback) override {
        // The same lookups, in the same order, as the gathering's own image
        // enumerator makes, so each region is matched to the image that
        // names it in the live run.
        VSImageEnumerator images(_images);
        _breakDown = breakDownPhysVestage();
        VSUserProcess::enumerateRegions([&](uint64_t start, uint64_t size, VSRegionInfo &info, int32_t state,
                                            const std::optional<std::string> &path) {
            _walked.push_back({start, size, info, state, path, images.nextImageForStart(start, start + size)});
            return callback(start, size, info, state, path);
        });
    }

private:
    std::vector<WalkedRegion> _walked;
    std::optional<std::string> _taskError;
    bool _ownsCaptureTask = false;
    bool _breakDown = false;
};

vs::HeapfileError captureError(int32_t pid, const std::string &reason) {
    return {std::string(vs::kVestageErrorDomain), 3, "process " + std::to_string(pid) + ": " + reason};
}

}  // namespace

namespace vs {

HeapfileCapture::HeapfileCapture(RegionIdentityProvider identities, std::optional<uint64_t> salt)
    : _identities(std::move(identities)) {
    if (salt) {
        _salt = *salt;
    } else {
        std::random_device random;
        _salt = (uint64_t(random()) << 32) ^ random();
    }
}

namespace {

// Walks a process opened (and prepared) for capture into its snapshot.
std::optional<VSHeapfileSnapshot> snapshotOf(VSCapturingProcess &process, const RegionIdentityProvider &identities,
                                             uint64_t sessionSalt, HeapfileError &error) {
    const uint64_t page = process.pageSize();
    process.gatherData();
    // A partial address space would pass for a whole one later.
    if (!process.errors().empty()) {
        error = captureError(process.pid(), process.errors().front());
        return std::nullopt;
    }
    if (!process.warnings().empty()) {
        error = captureError(process.pid(), process.warnings().front());
        return std::nullopt;
    }

    VSHeapfileSnapshot snapshot;
    snapshot.pid = process.pid();
    snapshot.name = process.name();
    snapshot.is64bit = process.is64bit();
    snapshot.description = std::string(architectureName(snapshot.is64bit)) + " process " + snapshot.name + " [" +
                           std::to_string(snapshot.pid) + "], no shared region";
    snapshot.pageSize = static_cast<uint32_t>(page);
    snapshot.physVestage = process.phys_vestage();
    snapshot.physVestagePeak = process.phys_vestage_peak();
    snapshot.breakDownPhysVestage = process.breakDownDuringWalk();

    const std::string salt = std::to_string(sessionSalt);
    const bool recalculate = process.anonymousDirtyRecalculation() && !snapshot.breakDownPhysVestage;

    for (const VSCapturingProcess::WalkedRegion &walked : process.walked()) {
        const VSRegionInfo &info = walked.info;
        VSHeapfileRegion region;
        region.address = walked.start;
        region.length = walked.size;
        if (walked.image != nullptr && walked.image->name()) {
            region.type = *walked.image->name();
            region.path = walked.image->ownerPath();
        } else if (walked.path && isNamedSharedMemoryTag(info.userTag)) {
            region.type = VSMemoryRegion::sharedMemoryCategoryName(*walked.path);
            region.path = walked.path;
        } else if (walked.path || info.externalPager != 0) {
            region.type = "mapped file";
            region.path = walked.path;
        } else {
            std::optional<std::string> tagName = VSMemoryRegion::categoryNameForTag(info.userTag);
            region.type = tagName && !tagName->empty() ? *tagName : "VM_ALLOCATE";
            // A descriptive type must never pass for a segment.
            if (namesSegment(region.type)) {
                region.type = "anonymous";
            }
        }
        region.protection = info.protection;
        region.maxProtection = info.maxProtection;
        region.userTag = info.userTag;
        if (info.userTag >= kFirstDynamicTag && info.userTag != kTagNonVolatilePhysVestage) {
            region.userTagName = dynamicTagName(info.userTag);
        }

        // Byte counts never exceed the region: the reader refuses such files.
        auto bytes = [&](uint64_t pages) { return std::min(pages * page, walked.size); };
        region.residentBytes = bytes(info.residentPages);
        region.sharedNowPrivateBytes = bytes(info.sharedNowPrivatePages);
        region.swappedBytes = bytes(info.swappedOutPages);
        uint64_t dirtyPages = info.dirtiedPages;
        const bool purgeableGone =
            walked.purgeableState == VSPurgeableVolatile || walked.purgeableState == VSPurgeableEmpty;
        if (!purgeableGone && info.externalPager == 0 && recalculate) {
            dirtyPages = info.residentPages > info.reusablePages ? info.residentPages - info.reusablePages : 0;
        }
        region.dirtyBytes = bytes(dirtyPages);

        region.referenceCount = static_cast<uint16_t>(std::min<uint32_t>(info.referenceCount, UINT16_MAX));
        region.externalPager = info.externalPager != 0 ? 1 : 0;
        region.shareMode = info.shareMode;
        region.submap = info.isSubmap != 0 ? 1 : 0;
        region.purgeableState = walked.purgeableState;
        region.offset = info.offset;
        if (info.objectId != 0) {
            std::optional<std::string> identity;
            if (identities) {
                identity = identities(info.objectId);
            }
            // Memory known only to this run is the session's: processes
            // captured together share it as they did live.
            region.objectId = objectIdForIdentity(
                identity ? *identity : "session " + salt + " object " + std::to_string(info.objectId));
        }
        snapshot.regions.push_back(std::move(region));
    }
    return snapshot;
}

}  // namespace

std::optional<VSHeapfileSnapshot> HeapfileCapture::capture(int32_t pid, HeapfileError *error) const {
    std::vector<Captured> captured = captureTogether({pid});
    if (!captured[0].snapshot && error != nullptr) {
        *error = captured[0].error;
    }
    return std::move(captured[0].snapshot);
}

std::vector<HeapfileCapture::Captured> HeapfileCapture::captureTogether(const std::vector<int32_t> &pids) const {
    VSPlatform &platform = VSPlatform::current();
    std::vector<Captured> results(pids.size());
    std::vector<std::unique_ptr<VSCapturingProcess>> processes(pids.size());
    // Every process is opened and prepared before any is walked, so that
    // the pages they share are known to be shared in each snapshot.
    bool waits = false;
    for (size_t i = 0; i < pids.size(); ++i) {
        const int32_t pid = pids[i];
        auto fail = [&](const std::string &reason) { results[i].error = captureError(pid, reason); };
        VSBsdInfo bsdInfo;
        if (platform.pid_bsd_info(pid, bsdInfo) != static_cast<int32_t>(sizeof(VSBsdInfo))) {
            fail("no such process, or not permitted to see it");
            continue;
        }
        if ((bsdInfo.flags & kBsdInfoFlagSystem) != 0) {
            fail("the kernel cannot be captured");
            continue;
        }
        auto process = std::make_unique<VSCapturingProcess>();
        if (!process->setUp(bsdInfo)) {
            fail(process->taskError().value_or("cannot be opened"));
            continue;
        }
        if (process->sharedRegionSize() != 0) {
            fail("has a shared cache region, which a heapfile capture cannot record");
            continue;
        }
        const uint64_t page = process->pageSize();
        if (page == 0 || (page & (page - 1)) != 0 || page > UINT32_MAX) {
            fail("unusable page size " + std::to_string(page));
            continue;
        }
        waits = process->prepareGatherData() || waits;
        processes[i] = std::move(process);
    }
    if (waits) {
        platform.resolve_shared_pages();
    }
    for (size_t i = 0; i < pids.size(); ++i) {
        if (processes[i]) {
            results[i].snapshot = snapshotOf(*processes[i], _identities, _salt, results[i].error);
        }
    }
    return results;
}

std::string heapfileFileName(const VSHeapfileSnapshot &snapshot) {
    std::string name = snapshot.name.empty() ? "process" : snapshot.name;
    for (char &c : name) {
        if (c == '/' || static_cast<unsigned char>(c) < 0x20 || c == 0x7F) {
            c = '_';
        }
    }
    if (name[0] == '.') {
        name[0] = '_';
    }
    return name + "-" + std::to_string(snapshot.pid) + ".heap";
}

bool writeFileAtomically(const std::string &path, const std::string &text, HeapfileError *error) {
    // A heapfile holds the layout of a process's memory: for the caller only.
    const std::optional<FileFailure> failure = writeOutputFile(path, text, 0600);
    if (failure && error != nullptr) {
        *error = {std::string(kPosixErrorDomain), failure->error, failure->reason};
    }
    return !failure;
}

}  // namespace vs
