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

} // namespace vs
