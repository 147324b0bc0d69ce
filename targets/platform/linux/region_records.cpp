#include "targets/platform/linux/region_records.h"

#include "model/memory_region.h"
#include "targets/platform/linux/object_ids.h"
#include "targets/platform/linux/packed_numbers.h"

#include <algorithm>
#include <string>
#include <string_view>
#include <type_traits>

namespace vs {

namespace {

bool startsWith(std::string_view s, std::string_view prefix) {
    return s.size() >= prefix.size() && s.compare(0, prefix.size(), prefix) == 0;
}

// "[anon:NAME]" -> NAME (the name itself may hold ']').
std::string_view bracketedName(std::string_view path, std::string_view prefix) {
    std::string_view name = path.substr(prefix.size());
    if (!name.empty() && name.back() == ']') {
        name.remove_suffix(1);
    }
    return name;
}

uint32_t sharedMemoryTag(std::string_view path) {
    if (startsWith(path, "/dev/zero")) {
        return kTagDevZero;
    }
    if (startsWith(path, "/memfd:")) {
        return kTagMemfd;
    }
    if (startsWith(path, "/SYSV")) {
        return kTagSysVSharedMemory;
    }
    if (startsWith(path, "/dev/shm/")) {
        return kTagPosixSharedMemory;
    }
    return kTagSharedMemory;
}

bool holdsStackPointer(const SmapsRegion &region, const std::vector<uint64_t> &stackPointers) {
    auto it = std::lower_bound(stackPointers.begin(), stackPointers.end(), region.start);
    return it != stackPointers.end() && *it < region.end;
}

} // namespace

uint32_t userTagFor(const SmapsRegion &region, MappingKind kind,
                    const std::vector<uint64_t> &stackPointers) {
    const std::string_view path = region.path;
    // Hugetlbfs files and MAP_HUGETLB memory alike: neither page cache nor
    // swappable.
    if (region.hasFlag(kVmHugetlb)) {
        return kTagHugetlb;
    }
    switch (kind) {
    case MappingKind::File:
        return 0;
    case MappingKind::Special:
        if (path == "[vdso]") {
            return kTagVdso;
        }
        if (path == "[vsyscall]") {
            return kTagVsyscall;
        }
        return kTagVvar;
    case MappingKind::SharedMemory:
        if (startsWith(path, "[anon_shmem:")) {
            return registerDynamicTagName(std::string(bracketedName(path, "[anon_shmem:")));
        }
        return sharedMemoryTag(path);
    case MappingKind::Anonymous:
        break;
    }
    // The brk heap stays "sbrk" even when a thread runs on a stack carved out
    // of it (user-level threads); only plain anonymous memory is named after
    // the stack pointers in it.
    if (path == "[heap]") {
        return kTagSbrk;
    }
    if (path == "[stack]" || (path.empty() && holdsStackPointer(region, stackPointers))) {
        return kTagStack;
    }
    if (path == "[uprobes]") {
        return kTagUprobes;
    }
    if (startsWith(path, "[anon:")) {
        return registerDynamicTagName(std::string(bracketedName(path, "[anon:")));
    }
    if (!region.read && !region.write && !region.exec && !region.shared) {
        return kTagGuard;
    }
    if (region.exec) {
        return kTagJitCode;
    }
    return 0;
}

uint64_t filePages(const SmapsRegion &region, uint64_t pageSize) {
    const uint64_t resident = region.rss / pageSize;
    return region.shared ? resident : resident - std::min<uint64_t>(resident, region.anonymous / pageSize);
}

bool isFileWindow(const SmapsRegion &region, MappingKind kind, uint64_t pageSize) {
    return region.inode != 0 && !region.hasFlag(kVmHugetlb) &&
           (kind == MappingKind::File || kind == MappingKind::SharedMemory) &&
           (region.shared || filePages(region, pageSize) > 0);
}

uint64_t fileDirtyPages(const SmapsRegion &region, uint64_t pageSize) {
    const uint64_t dirty = (region.privateDirty + region.sharedDirty) / pageSize;
    if (region.shared) {
        return dirty;
    }
    // Dirty page cache (written with write()) belongs to the file; every
    // anonymous page but a lazily freed one is dirty.
    const uint64_t anonymous = std::min(region.anonymous, region.rss) / pageSize;
    const uint64_t lazyFree = region.lazyFree / pageSize;
    return dirty - std::min(dirty, anonymous - std::min(anonymous, lazyFree));
}

bool mayShareAnonymousPages(const SmapsRegion &region, MappingKind kind) {
    if (region.shared || kind == MappingKind::Special || region.hasFlag(kVmHugetlb)) {
        return false;
    }
    // Anonymous pages mapped more than once show as shared; so do the page
    // cache pages of a file mapping, which only the frames tell apart.
    // Swap entries that several processes hold bring SwapPss below Swap.
    return (region.anonymous > 0 && region.sharedClean + region.sharedDirty > 0) || region.swap > region.swapPss;
}

namespace {

uint32_t pagesOf(uint64_t count) {
    return count > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(count);
}

// The fields every part of a mapping has in common.
VSRegionInfo commonRecord(const SmapsRegion &region, uint32_t userTag) {
    VSRegionInfo info;
    info.protection = (region.read ? kProtRead : 0) | (region.write ? kProtWrite : 0) |
                      (region.exec ? kProtExecute : 0);
    info.maxProtection = (region.hasFlag(kVmMayRead) ? kProtRead : 0) |
                         (region.hasFlag(kVmMayWrite) ? kProtWrite : 0) |
                         (region.hasFlag(kVmMayExec) ? kProtExecute : 0);
    if (region.hasFlag(kVmDontCopy)) {
        info.inheritance = kInheritNone;
    } else {
        info.inheritance = region.shared ? kInheritShare : kInheritCopy;
    }
    info.userTag = userTag;
    info.referenceCount = 1;
    return info;
}

struct PartPages {
    uint64_t resident = 0;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t reusable = 0;
};

VSRegionInfo part(VSRegionInfo info, const SmapsRegion &region, uint32_t objectId, uint64_t offset,
                  const PartPages &pages, bool droppable, uint8_t shareMode) {
    info.objectId = objectId;
    info.offset = offset;
    info.residentPages = pagesOf(pages.resident);
    info.dirtiedPages = pagesOf(std::min(pages.dirty, pages.resident));
    info.swappedOutPages = pagesOf(pages.swapped);
    info.reusablePages = pagesOf(std::min(pages.reusable, pages.resident));
    info.externalPager = droppable ? 1 : 0;
    info.shareMode = pages.resident + pages.swapped == 0 ? kShareModeEmpty : shareMode;
    // Locked is a proportional share; the part's own locked pages are all
    // its resident pages.
    if (region.hasFlag(kVmLocked)) {
        info.userWiredCount = static_cast<uint16_t>(std::min<uint64_t>(pages.resident, 0xFFFF));
    }
    return info;
}

uint64_t clampedDifference(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
}

} // namespace

std::vector<VSRegionInfo> regionPartsFor(const SmapsRegion &region, MappingKind kind, uint32_t userTag,
                                         ObjectIdTable &ids, uint64_t pageSize,
                                         const std::vector<SharedAnonymousPart> &shared,
                                         const std::optional<ObjectPages> &objectPages) {
    const VSRegionInfo common = commonRecord(region, userTag);
    const uint64_t device = objectDevice(region);
    const auto pages = [pageSize](uint64_t bytes) { return bytes / pageSize; };
    std::vector<VSRegionInfo> parts;

    if (region.hasFlag(kVmHugetlb)) {
        // Hugetlb pages cannot be dropped or swapped; Rss leaves them out.
        const uint64_t resident = pages(region.privateHugetlb + region.sharedHugetlb);
        const uint32_t id = region.shared && region.inode != 0 ? ids.idForFile(device, region.inode)
                                                               : ids.freshId();
        parts.push_back(part(common, region, id, region.shared ? region.offset : 0, {resident, resident, 0, 0},
                             false, region.shared ? kShareModeShared : kShareModePrivate));
        return parts;
    }
    if (kind == MappingKind::Special) {
        // The same kernel pages in every process: one shared object.
        const uint64_t resident = pages(region.rss);
        parts.push_back(part(common, region, ids.idForName(region.path), 0,
                             {resident, pages(region.privateDirty + region.sharedDirty), 0, 0}, false,
                             kShareModeShared));
        return parts;
    }
    const bool fileLike = kind == MappingKind::File || kind == MappingKind::SharedMemory;
    const bool droppable = kind == MappingKind::File;
    if (region.shared) {
        // Every page of a shared mapping is the object's own page.
        const uint32_t id = region.inode != 0 ? ids.idForFile(device, region.inode) : ids.freshId();
        PartPages counts{pages(region.rss), pages(region.privateDirty + region.sharedDirty), pages(region.swap),
                         pages(region.lazyFree)};
        if (objectPages) {
            counts.resident = objectPages->residentPages;
            counts.dirty = objectPages->dirtyPages;
        }
        parts.push_back(part(common, region, id, fileLike ? region.offset : 0, counts, droppable, kShareModeShared));
        return parts;
    }

    // A private mapping: page cache pages of its file, copies of its own,
    // and anonymous pages it shares with other targets.
    const uint64_t resident = pages(region.rss);
    const bool hasFile = fileLike && region.inode != 0;
    // Without a file every resident page is anonymous.
    const uint64_t anonymous = hasFile ? std::min(pages(region.anonymous), resident) : resident;
    const uint64_t lazyFree = pages(region.lazyFree);
    uint64_t sharedPresent = 0;
    uint64_t sharedSwapped = 0;
    for (const SharedAnonymousPart &set : shared) {
        sharedPresent += set.presentPages;
        sharedSwapped += set.swappedPages;
    }
    // pagemap and smaps are two looks at a changing process: the shared
    // parts come from the frames, the rest stays the mapping's own.
    const uint64_t ownPresent = clampedDifference(anonymous, sharedPresent);
    const uint64_t ownSwapped = clampedDifference(pages(region.swap), sharedSwapped);
    if (hasFile) {
        uint64_t cached = filePages(region, pageSize);
        uint64_t cachedDirty = fileDirtyPages(region, pageSize);
        if (objectPages && cached > 0) {
            // Other mappings of the window hold other pages of it.
            cached = objectPages->residentPages;
            cachedDirty = objectPages->dirtyPages;
        }
        // Always first, even when every page is a copy: the walk names a
        // mapping's parts after the file its first part is backed by.
        const uint32_t id = ids.idForFileWindow(device, region.inode, region.offset);
        parts.push_back(part(common, region, id, region.offset, {cached, cachedDirty, 0, 0}, droppable,
                             kShareModeShared));
    }
    if (ownPresent + ownSwapped > 0 || (parts.empty() && sharedPresent + sharedSwapped == 0)) {
        parts.push_back(part(common, region, ids.freshId(), 0,
                             {ownPresent, clampedDifference(ownPresent, lazyFree), ownSwapped, lazyFree}, false,
                             kShareModePrivate));
    }
    for (const SharedAnonymousPart &set : shared) {
        if (set.presentPages + set.swappedPages == 0) {
            continue;
        }
        // Shared copies sit at the same address in every process of a fork
        // family: the address places them in the set's object, so each
        // frame counts once however many members map it.
        parts.push_back(part(common, region, set.objectId, set.offset,
                             {set.presentPages, set.presentPages, set.swappedPages, 0}, false, kShareModeShared));
    }
    return parts;
}

VSRegionBasicInfo basicInfoFor(const SmapsRegion &region, MappingKind kind, uint64_t pageSize) {
    const VSRegionInfo common = commonRecord(region, 0);
    VSRegionBasicInfo basic;
    basic.protection = common.protection;
    basic.maxProtection = common.maxProtection;
    basic.inheritance = common.inheritance;
    basic.shared = region.shared ? 1 : 0;
    basic.offset = kind == MappingKind::File || kind == MappingKind::SharedMemory ? region.offset : 0;
    if (region.hasFlag(kVmLocked)) {
        basic.userWiredCount = static_cast<uint16_t>(std::min<uint64_t>(region.rss / pageSize, 0xFFFF));
    }
    return basic;
}

namespace {

// The fields of a record, in packing order, each read and written by name:
// the record is packed, its 64-bit offset is not naturally aligned, and a
// member pointer or reference to it would read it as if it were.
#define VS_RECORD_FIELDS(FIELD)                                                                                   \
    FIELD(protection) FIELD(maxProtection) FIELD(inheritance) FIELD(offset) FIELD(userTag) FIELD(residentPages)  \
    FIELD(sharedNowPrivatePages) FIELD(swappedOutPages) FIELD(dirtiedPages) FIELD(referenceCount)               \
    FIELD(shadowDepth) FIELD(externalPager) FIELD(shareMode) FIELD(isSubmap) FIELD(behaviour) FIELD(objectId)   \
    FIELD(userWiredCount) FIELD(_padding) FIELD(reusablePages)

// The unsigned number of a field's width packs it (the signed fields come
// back through the same cast).
template <class Field>
void putField(std::vector<uint8_t> &out, Field value) {
    putPackedNumber(out, static_cast<std::make_unsigned_t<Field>>(value));
}

template <class Field>
Field takeField(std::span<const uint8_t> bytes, size_t &at) {
    return static_cast<Field>(static_cast<std::make_unsigned_t<Field>>(takePackedNumber(bytes, at)));
}

} // namespace

void packRegionInfo(const VSRegionInfo &info, std::vector<uint8_t> &out) {
#define VS_PUT_FIELD(name) putField<decltype(VSRegionInfo::name)>(out, info.name);
    VS_RECORD_FIELDS(VS_PUT_FIELD)
#undef VS_PUT_FIELD
}

VSRegionInfo unpackRegionInfo(std::span<const uint8_t> bytes, size_t &at) {
    VSRegionInfo info;
#define VS_TAKE_FIELD(name) info.name = takeField<decltype(VSRegionInfo::name)>(bytes, at);
    VS_RECORD_FIELDS(VS_TAKE_FIELD)
#undef VS_TAKE_FIELD
    return info;
}

#undef VS_RECORD_FIELDS

} // namespace vs
