#pragma once

// Parsers for the kernel-wide memory files of /proc: slabinfo (the
// kernel's zones), vmallocinfo (wired memory by the code that asked for
// it) and modules. Pure
// functions over text, tested on recorded captures.

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace vs {

struct SlabCache {
    std::string name;
    uint64_t activeObjects = 0;
    uint64_t objectSize = 0;
    uint64_t pagesPerSlab = 0;
    uint64_t slabs = 0; // num_slabs
};

// Version 2.x slabinfo; the two header lines are skipped.
std::vector<SlabCache> parseSlabinfo(std::string_view text);

// vmallocinfo summed per caller. `caller` is the text the kernel prints
// ("kernel_clone+0x94/0x3e0"); areas without a caller, and ioremap areas,
// which are device memory and not RAM, are left out. Callers keep the
// order of their first area.
struct VmallocCaller {
    std::string caller;
    uint64_t pages = 0;
    uint64_t areas = 0;
};
std::vector<VmallocCaller> parseVmallocinfo(std::string_view text);

// "symbol+0x94/0x3e0" -> symbol and offset. False when the text has no
// offset part.
bool splitCaller(std::string_view caller, std::string_view &symbol, uint64_t &offset);

struct KernelModule {
    std::string name;
    uint64_t size = 0;
    uint64_t address = 0;
};
std::vector<KernelModule> parseModules(std::string_view text);

// "Name:   123 kB" lines of meminfo, in file order, values in bytes.
struct MeminfoEntry {
    std::string name;
    uint64_t bytes = 0;
};
std::vector<MeminfoEntry> parseMeminfo(std::string_view text);

// Free pages the per-CPU lists hold, which MemFree leaves out: the sum of
// the `count:` lines of /proc/zoneinfo's pagesets, in pages.
uint64_t parsePerCpuFreePages(std::string_view zoneinfo);

// What the kernel holds beyond the parts it names itself, so that the
// kernel target and the processes' share add up to MemTotal - MemFree.
// All figures in bytes; a meminfo line the kernel lacks reads as 0.
struct KernelBooksInput {
    // From /proc/meminfo.
    uint64_t memTotal = 0, memFree = 0, anonPages = 0, mapped = 0;
    uint64_t cached = 0, buffers = 0, swapCached = 0, shmem = 0, dirty = 0, writeback = 0;
    uint64_t sReclaimable = 0, sUnreclaim = 0;
    uint64_t hugetlb = 0, hugePagesTotal = 0, hugePagesFree = 0, hugePageSize = 0;
    // What the kernel target lists already: the slab zones (and the part
    // of them in reclaimable caches), and every other kernel figure
    // (vmalloc areas, kernel stacks, page tables, per-cpu areas, zswap).
    uint64_t zones = 0, reclaimableZones = 0, otherListed = 0;
    uint64_t perCpuFree = 0;
};
struct KernelBooks {
    // Slab pages in no listed cache: large kmalloc, slabs waiting for RCU.
    uint64_t slabOutsideCaches = 0, slabOutsideCachesReclaimable = 0;
    // Page cache no process maps (dirty: written, not yet on disk), and
    // the tmpfs and shared memory among it, which cannot simply be dropped.
    uint64_t unmappedPageCache = 0, unmappedPageCacheDirty = 0, unmappedTmpfs = 0;
    uint64_t perCpuFree = 0;
    uint64_t unusedHugetlb = 0;
    // What remains of MemTotal - MemFree once all of the above, the listed
    // figures and the processes' share are taken out; never below 0.
    uint64_t unnamed = 0;
    bool unnamedClamped = false;
};
KernelBooks closeKernelBooks(const KernelBooksInput &in);

} // namespace vs
