#include "targets/platform/linux/region_records.h"

#include "model/memory_region.h"
#include "targets/platform/linux/object_ids.h"

#include <algorithm>
#include <string>
#include <string_view>

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

uint32_t pages(uint64_t bytes, uint64_t pageSize) {
    const uint64_t count = bytes / pageSize;
    return count > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(count);
}

} // namespace

uint32_t userTagFor(const SmapsRegion &region, MappingKind kind,
                    const std::vector<uint64_t> &stackPointers) {
    const std::string_view path = region.path;
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
    if (path == "[stack]" || holdsStackPointer(region, stackPointers)) {
        return kTagStack;
    }
    if (path == "[heap]") {
        return kTagSbrk;
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

uint32_t objectIdFor(const SmapsRegion &region, MappingKind kind, ObjectIdTable &ids) {
    switch (kind) {
    case MappingKind::File:
    case MappingKind::SharedMemory:
        if (region.inode != 0) {
            return ids.idForFile((uint64_t{region.devMajor} << 32) | region.devMinor,
                                 region.inode);
        }
        return ids.freshId(); // [anon_shmem:NAME] shows no inode
    case MappingKind::Special:
        return ids.idForName(region.path);
    case MappingKind::Anonymous:
        break;
    }
    return ids.freshId();
}

VSRegionInfo regionInfoFor(const SmapsRegion &region, MappingKind kind, uint32_t userTag,
                           uint32_t objectId, uint64_t pageSize) {
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
    // Anonymous memory is its own object, so it starts at offset 0 of it.
    const bool fileLike = kind == MappingKind::File || kind == MappingKind::SharedMemory;
    info.offset = fileLike ? region.offset : 0;
    info.userTag = userTag;
    info.residentPages = pages(region.rss, pageSize);
    info.swappedOutPages = pages(region.swap, pageSize);
    info.dirtiedPages = pages(region.privateDirty + region.sharedDirty, pageSize);
    info.reusablePages = pages(region.lazyFree, pageSize);
    info.referenceCount = 1;
    info.externalPager = kind == MappingKind::File ? 1 : 0;
    // The kernel's special mappings are the same pages in every process, so
    // they are one shared object rather than a private copy per process.
    if (region.shared || kind == MappingKind::Special) {
        info.shareMode = kShareModeShared;
    } else if (region.rss + region.swap == 0) {
        info.shareMode = kShareModeEmpty;
    } else if (kind == MappingKind::File || region.sharedClean + region.sharedDirty > 0) {
        info.shareMode = kShareModeCopyOnWrite;
    } else {
        info.shareMode = kShareModePrivate;
    }
    info.objectId = objectId;
    // Locked is a proportional share; the region's own locked pages are
    // all its resident pages.
    if (region.hasFlag(kVmLocked)) {
        info.userWiredCount = static_cast<uint16_t>(std::min<uint64_t>(region.rss / pageSize, 0xFFFF));
    }
    return info;
}

VSRegionBasicInfo basicInfoFor(const SmapsRegion &region, MappingKind kind, uint64_t pageSize) {
    const VSRegionInfo full = regionInfoFor(region, kind, 0, 0, pageSize);
    VSRegionBasicInfo basic;
    basic.protection = full.protection;
    basic.maxProtection = full.maxProtection;
    basic.inheritance = full.inheritance;
    basic.shared = region.shared ? 1 : 0;
    basic.offset = full.offset;
    basic.userWiredCount = full.userWiredCount;
    return basic;
}

} // namespace vs
