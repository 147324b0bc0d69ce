// The kernel target's queries and the corpse hand-over of the Linux layer.
//
// Zones are the slab caches of /proc/slabinfo. Wired memory by site comes
// from three sources: /proc/meminfo for what the kernel keeps per purpose
// (kernel stacks, page tables, per-cpu areas ...),
// /proc/modules for loaded modules, and /proc/vmallocinfo summed per
// calling code, named as the kernel prints it. meminfo totals
// become the counter entries. Named tag sites close the books: slab pages
// in no listed cache, page cache and tmpfs no process maps, free pages on
// per-CPU lists, the unused hugetlb pool and what nothing names, so that
// the kernel target and the processes' share (AnonPages + Mapped) add up
// to MemTotal - MemFree. Locked user pages are left to the processes,
// which count them.

#include "targets/platform/linux/kernel_text.h"
#include "targets/platform/linux/linux_platform.h"
#include "targets/platform/linux/proc_reader.h"
#include "targets/platform/linux/proc_text.h"

#include <algorithm>
#include <optional>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>
#include <unordered_map>

struct VSLinuxPlatform::KernelArrays {
    std::vector<VSKernelZoneName> zoneNames;
    std::vector<VSKernelZoneInfo> zoneInfos;
    std::vector<VSKernelSiteInfo> siteInfos;
    bool zoneNamesHeld = true;
    bool zoneInfosHeld = true;
    bool siteInfosHeld = true;
};

namespace {

// meminfo lines that are wired kernel memory of one purpose, with the
// kernel-site tag they are reported under.
struct MeminfoSite {
    const char *name;
    uint64_t tag;
};
constexpr MeminfoSite kMeminfoSites[] = {
    {"KernelStack", 8},   // stacks of all threads
    {"Percpu", 9},        // per-cpu areas
    {"SecPageTables", 10}, // page tables of secondary MMUs (IOMMU, KVM)
    {"PageTables", 11},   // process page tables
    {"Zswap", 15},        // compressed pages
};

constexpr uint64_t kKernelStackTag = 8;

// Tag slots of what closes the books: named sites, far from the fixed tags.
constexpr uint64_t kFirstBooksTag = 240;

uint64_t meminfo(std::string_view text, const char *name) { return vs::statusBytes(text, name).value_or(0); }

// Where vmalloc'd thread stacks come from; depending on inlining the kernel
// names one of these as the caller.
bool isThreadStackAllocator(std::string_view symbol) {
    return symbol == "alloc_thread_stack_node" || symbol == "dup_task_struct" || symbol == "copy_process" ||
           symbol == "kernel_clone";
}

// meminfo totals reported as counters, with their counter index.
struct MeminfoCounter {
    const char *name;
    uint64_t index;
};
constexpr MeminfoCounter kMeminfoCounters[] = {
    {"MemTotal", 0},    // pages the kernel manages
    {"Unevictable", 2}, // pages that cannot be reclaimed
    {"VmallocUsed", 6}, // the kernel's own address space in use
    {"Slab", 7},        // all zones together
};

// vmalloc callers get made-up site numbers up here, far from any small
// index; the listing's 40-bit object ids then show just the caller's number.
constexpr uint64_t kCallerSiteBase = 1ull << 40;

void setName(char (&field)[80], std::string_view text) {
    std::memset(field, 0, sizeof field);
    std::memcpy(field, text.data(), std::min(sizeof field - 1, text.size()));
}

bool slabReclaimable(const std::string &name) {
    const std::string path = "/sys/kernel/slab/" + name + "/reclaim_account";
    char text[8] = {};
    const int64_t n = vs::readBytesAt(AT_FDCWD, path.c_str(), 0, text, sizeof text - 1);
    return n > 0 && text[0] == '1';
}

} // namespace

VSReturnCode VSLinuxPlatform::kernel_memory_info(std::span<const VSKernelZoneName> &zoneNames,
                                                 std::span<const VSKernelZoneInfo> &zoneInfos,
                                                 std::span<const VSKernelSiteInfo> &siteInfos) {
    zoneNames = {};
    zoneInfos = {};
    siteInfos = {};
    auto arrays = std::make_shared<KernelArrays>();
    vs::ReadBuffer buffer;
    std::string_view text;

    // Zones. slabinfo is root-only; without it there is no kernel target.
    int error = vs::readFileAt(AT_FDCWD, "/proc/slabinfo", buffer, text);
    if (error != 0) {
        return error;
    }
    for (const vs::SlabCache &cache : vs::parseSlabinfo(text)) {
        VSKernelZoneName name;
        std::memcpy(name.name, cache.name.data(), std::min(sizeof name.name, cache.name.size()));
        VSKernelZoneInfo info;
        info.elementsInUse = cache.activeObjects;
        info.elementSize = cache.objectSize;
        info.currentSize = cache.slabs * cache.pagesPerSlab * _pageSize;
        info.collectable = slabReclaimable(cache.name) ? 1 : 0;
        arrays->zoneNames.push_back(name);
        arrays->zoneInfos.push_back(info);
    }

    // Sites by purpose, and the counters, from meminfo.
    error = vs::readFileAt(AT_FDCWD, "/proc/meminfo", buffer, text);
    if (error != 0) {
        return error;
    }
    vs::KernelBooksInput books;
    books.memTotal = meminfo(text, "MemTotal");
    books.memFree = meminfo(text, "MemFree");
    books.anonPages = meminfo(text, "AnonPages");
    books.mapped = meminfo(text, "Mapped");
    books.cached = meminfo(text, "Cached");
    books.buffers = meminfo(text, "Buffers");
    books.swapCached = meminfo(text, "SwapCached");
    books.shmem = meminfo(text, "Shmem");
    books.dirty = meminfo(text, "Dirty");
    books.writeback = meminfo(text, "Writeback");
    books.sReclaimable = meminfo(text, "SReclaimable");
    books.sUnreclaim = meminfo(text, "SUnreclaim");
    books.hugetlb = meminfo(text, "Hugetlb");
    books.hugePageSize = meminfo(text, "Hugepagesize");
    // Page counts, printed without a unit.
    books.hugePagesTotal = meminfo(text, "HugePages_Total");
    books.hugePagesFree = meminfo(text, "HugePages_Free");
    for (size_t i = 0; i < arrays->zoneInfos.size(); ++i) {
        books.zones += arrays->zoneInfos[i].currentSize;
        if (arrays->zoneInfos[i].collectable != 0) {
            books.reclaimableZones += arrays->zoneInfos[i].currentSize;
        }
    }
    std::optional<size_t> kernelStackSite;
    for (const MeminfoSite &site : kMeminfoSites) {
        if (auto bytes = vs::statusBytes(text, site.name)) {
            if (site.tag == kKernelStackTag) {
                kernelStackSite = arrays->siteInfos.size();
            }
            VSKernelSiteInfo info;
            info.flags = vs::kSiteTypeTag | vs::kSiteFlagWired;
            info.site = site.tag;
            info.size = *bytes;
            info.tag = static_cast<uint16_t>(site.tag);
            arrays->siteInfos.push_back(info);
        }
    }
    for (const MeminfoCounter &counter : kMeminfoCounters) {
        if (auto bytes = vs::statusBytes(text, counter.name)) {
            VSKernelSiteInfo info;
            info.flags = vs::kSiteTypeCounter;
            info.site = counter.index;
            info.mapped = *bytes;
            arrays->siteInfos.push_back(info);
        }
    }

    // Modules, when the kernel has them.
    if (vs::readFileAt(AT_FDCWD, "/proc/modules", buffer, text) == 0) {
        uint64_t loadTag = 0;
        for (const vs::KernelModule &module : vs::parseModules(text)) {
            VSKernelSiteInfo info;
            info.flags = vs::kSiteTypeKext | vs::kSiteFlagWired;
            info.site = ++loadTag;
            info.size = module.size;
            arrays->siteInfos.push_back(info);
        }
    }

    // vmalloc areas by calling code address. The kernel prints each caller
    // already named ("kernel_clone+0x94/0x3e0"); finding its address would
    // mean reading all of kallsyms, which costs the kernel more than every
    // other kernel file together. So each caller is a site of its own under
    // a made-up number, carrying the function's name.
    if (vs::readFileAt(AT_FDCWD, "/proc/vmallocinfo", buffer, text) == 0) {
        uint64_t callerNumber = 0;
        uint64_t stackBytes = 0;
        for (const vs::VmallocCaller &caller : vs::parseVmallocinfo(text)) {
            VSKernelSiteInfo info;
            info.flags = vs::kSiteTypeCodeAddress | vs::kSiteFlagWired | vs::kSiteFlagNamed;
            info.site = kCallerSiteBase + ++callerNumber;
            info.size = caller.pages * _pageSize;
            std::string_view symbol;
            uint64_t offset = 0;
            vs::splitCaller(caller.caller, symbol, offset);
            if (isThreadStackAllocator(symbol)) {
                stackBytes += info.size;
            }
            setName(info.name, symbol);
            arrays->siteInfos.push_back(info);
        }
        // With virtually mapped stacks the same pages are also counted in
        // KernelStack: count them once, under the code that allocated them.
        if (kernelStackSite) {
            uint64_t &size = arrays->siteInfos[*kernelStackSite].size;
            size -= std::min(size, stackBytes);
        }
    }

    // What closes the books: the kernel's memory beyond what it names.
    for (const VSKernelSiteInfo &site : arrays->siteInfos) {
        if ((site.flags & vs::kSiteTypeMask) != vs::kSiteTypeCounter) {
            books.otherListed += site.size;
        }
    }
    if (vs::readFileAt(AT_FDCWD, "/proc/zoneinfo", buffer, text) == 0) {
        books.perCpuFree = vs::parsePerCpuFreePages(text) * _pageSize;
    }
    const vs::KernelBooks closed = vs::closeKernelBooks(books);
    struct BooksSite {
        const char *name;
        uint64_t size, reclaimable;
        bool wired;
    };
    const BooksSite booksSites[] = {
        {"slab outside caches", closed.slabOutsideCaches, closed.slabOutsideCachesReclaimable, true},
        {"page cache no process maps", closed.unmappedPageCache,
         closed.unmappedPageCache - closed.unmappedPageCacheDirty, true},
        {"tmpfs no process maps", closed.unmappedTmpfs, 0, false},
        {"free pages held per CPU", closed.perCpuFree, closed.perCpuFree, true},
        {"unused hugetlb pool", closed.unusedHugetlb, 0, true},
        {"unnamed kernel memory", closed.unnamed, 0, true},
    };
    uint64_t booksTag = kFirstBooksTag;
    for (const BooksSite &entry : booksSites) {
        // What nothing names is shown even when it is nothing.
        const bool always = &entry == &booksSites[std::size(booksSites) - 1];
        if (entry.size == 0 && !always) {
            ++booksTag;
            continue;
        }
        VSKernelSiteInfo info;
        info.flags = vs::kSiteTypeTag | vs::kSiteFlagNamed | (entry.wired ? vs::kSiteFlagWired : 0);
        info.site = booksTag;
        info.tag = static_cast<uint16_t>(booksTag++);
        info.size = entry.size;
        info.collectable = entry.reclaimable;
        setName(info.name, entry.name);
        arrays->siteInfos.push_back(info);
    }

    zoneNames = arrays->zoneNames;
    zoneInfos = arrays->zoneInfos;
    siteInfos = arrays->siteInfos;
    std::lock_guard<std::mutex> lock(_kernelArraysMutex);
    _kernelArrays.push_back(std::move(arrays));
    return 0;
}

VSReturnCode VSLinuxPlatform::release_memory(const void *address, uint64_t length) {
    std::lock_guard<std::mutex> lock(_kernelArraysMutex);
    for (auto it = _kernelArrays.begin(); it != _kernelArrays.end(); ++it) {
        KernelArrays &a = **it;
        bool matched = false;
        auto release = [&](const auto &vector, bool &held) {
            using Element = typename std::decay_t<decltype(vector)>::value_type;
            if (!matched && held && static_cast<const void *>(vector.data()) == address &&
                length == vector.size() * sizeof(Element)) {
                held = false;
                matched = true;
            }
        };
        release(a.zoneNames, a.zoneNamesHeld);
        release(a.zoneInfos, a.zoneInfosHeld);
        release(a.siteInfos, a.siteInfosHeld);
        if (matched) {
            if (!a.zoneNamesHeld && !a.zoneInfosHeld && !a.siteInfosHeld) {
                _kernelArrays.erase(it);
            }
            return 0;
        }
    }
    return EINVAL;
}

std::map<std::string, VSKextInfo> VSLinuxPlatform::loaded_kext_info() {
    std::map<std::string, VSKextInfo> result;
    std::string_view text;
    if (vs::readFileAt(AT_FDCWD, "/proc/modules", text) != 0) {
        return result;
    }
    // Load tags count modules in file order, as kernel_memory_info does.
    uint64_t loadTag = 0;
    for (const vs::KernelModule &module : vs::parseModules(text)) {
        VSKextInfo info;
        info.loadTag = ++loadTag;
        info.bundleIdentifier = module.name;
        info.loadAddress = module.address;
        info.size = module.size;
        result.emplace(module.name, std::move(info));
    }
    return result;
}

std::unique_ptr<VSKernelSymbolicator> VSLinuxPlatform::kernel_symbolicator() {
    // Every code-address site carries its caller's name already.
    return nullptr;
}

VSReturnCode VSLinuxPlatform::ports_lookup(std::vector<uint32_t> &ports) {
    // A crash helper started through core_pattern's %F finds the crashing
    // task's pidfd on fd 3. It becomes a task handle of this layer, which
    // the region queries accept like any other.
    ports.clear();
    char link[64] = {};
    if (::readlink("/proc/self/fd/3", link, sizeof link - 1) <= 0 ||
        std::strstr(link, "pidfd") == nullptr) {
        return 0;
    }
    std::string_view fdinfo;
    if (vs::readFileAt(AT_FDCWD, "/proc/self/fdinfo/3", fdinfo) != 0) {
        return 0;
    }
    const auto pidText = vs::statusValue(fdinfo, "Pid");
    if (!pidText) {
        return 0;
    }
    const int32_t pid = static_cast<int32_t>(std::strtol(std::string(*pidText).c_str(), nullptr, 10));
    if (pid <= 0) {
        return 0;
    }
    VSTaskHandle task = vs::kTaskHandleNone;
    if (task_handle_for_pid(pid, task) != 0) {
        return 0;
    }
    // The pid could have been reused before /proc/PID was opened; the pidfd
    // still names the crashing task, so its pid must still read the same.
    const std::string expected = std::to_string(pid);
    if (vs::readFileAt(AT_FDCWD, "/proc/self/fdinfo/3", fdinfo) != 0 ||
        vs::statusValue(fdinfo, "Pid").value_or("") != expected) {
        release_task_handle(task);
        return 0;
    }
    ports.push_back(task);
    return 0;
}
