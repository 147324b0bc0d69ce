#include "targets/platform/linux/kernel_text.h"

#include <algorithm>
#include <unordered_map>

namespace vs {

namespace {

// Splits text into lines (the last one may lack its newline).
template <typename Visit>
void forEachLine(std::string_view text, Visit visit) {
    size_t pos = 0;
    while (pos < text.size()) {
        size_t newline = text.find('\n', pos);
        if (newline == std::string_view::npos) {
            newline = text.size();
        }
        visit(text.substr(pos, newline - pos));
        pos = newline + 1;
    }
}

// Blank-separated fields of a line, at most `max`.
size_t fields(std::string_view line, std::string_view *out, size_t max) {
    size_t count = 0;
    size_t pos = 0;
    while (count < max) {
        while (pos < line.size() && (line[pos] == ' ' || line[pos] == '\t')) {
            ++pos;
        }
        if (pos >= line.size()) {
            break;
        }
        const size_t start = pos;
        while (pos < line.size() && line[pos] != ' ' && line[pos] != '\t') {
            ++pos;
        }
        out[count++] = line.substr(start, pos - start);
    }
    return count;
}

bool decimal(std::string_view s, uint64_t &value) {
    if (s.empty()) {
        return false;
    }
    uint64_t v = 0;
    for (char c : s) {
        if (c < '0' || c > '9') {
            return false;
        }
        v = v * 10 + static_cast<uint64_t>(c - '0');
    }
    value = v;
    return true;
}

bool hex(std::string_view s, uint64_t &value) {
    if (s.size() > 2 && s[0] == '0' && (s[1] == 'x' || s[1] == 'X')) {
        s.remove_prefix(2);
    }
    if (s.empty() || s.size() > 16) {
        return false;
    }
    uint64_t v = 0;
    for (char c : s) {
        int digit;
        if (c >= '0' && c <= '9') {
            digit = c - '0';
        } else if (c >= 'a' && c <= 'f') {
            digit = c - 'a' + 10;
        } else if (c >= 'A' && c <= 'F') {
            digit = c - 'A' + 10;
        } else {
            return false;
        }
        v = (v << 4) | static_cast<uint64_t>(digit);
    }
    value = v;
    return true;
}

bool startsWith(std::string_view s, std::string_view prefix) {
    return s.size() >= prefix.size() && s.compare(0, prefix.size(), prefix) == 0;
}

} // namespace

std::vector<SlabCache> parseSlabinfo(std::string_view text) {
    // name active_objs num_objs objsize objperslab pagesperslab : tunables
    // l b s : slabdata active_slabs num_slabs sharedavail
    std::vector<SlabCache> caches;
    forEachLine(text, [&](std::string_view line) {
        if (line.empty() || startsWith(line, "slabinfo") || line[0] == '#') {
            return;
        }
        std::string_view f[16];
        const size_t n = fields(line, f, 16);
        if (n < 16 || f[6] != ":" || f[11] != ":") {
            return;
        }
        SlabCache cache;
        cache.name.assign(f[0]);
        if (!decimal(f[1], cache.activeObjects) || !decimal(f[3], cache.objectSize) ||
            !decimal(f[5], cache.pagesPerSlab) || !decimal(f[14], cache.slabs)) {
            return;
        }
        caches.push_back(std::move(cache));
    });
    return caches;
}

bool splitCaller(std::string_view caller, std::string_view &symbol, uint64_t &offset) {
    const size_t plus = caller.rfind('+');
    const size_t slash = caller.rfind('/');
    if (plus == std::string_view::npos || slash == std::string_view::npos || slash < plus ||
        plus == 0) {
        return false;
    }
    if (!hex(caller.substr(plus + 1, slash - plus - 1), offset)) {
        return false;
    }
    symbol = caller.substr(0, plus);
    return true;
}

std::vector<VmallocCaller> parseVmallocinfo(std::string_view text) {
    std::vector<VmallocCaller> callers;
    std::unordered_map<std::string, size_t> index;
    forEachLine(text, [&](std::string_view line) {
        std::string_view f[24];
        const size_t n = fields(line, f, 24);
        if (n < 3) {
            return;
        }
        std::string_view symbol;
        uint64_t offset = 0;
        if (!splitCaller(f[2], symbol, offset)) {
            return; // unpurged areas and the like name no caller
        }
        uint64_t pages = 0;
        bool havePages = false;
        for (size_t i = 3; i < n; ++i) {
            if (f[i] == "ioremap") {
                return; // device memory, not RAM
            }
            if (startsWith(f[i], "pages=")) {
                havePages = decimal(f[i].substr(6), pages);
            }
        }
        if (!havePages) {
            return;
        }
        auto [it, inserted] = index.try_emplace(std::string(f[2]), callers.size());
        if (inserted) {
            callers.push_back(VmallocCaller{std::string(f[2]), 0, 0});
        }
        callers[it->second].pages += pages;
        callers[it->second].areas += 1;
    });
    return callers;
}

std::vector<KernelModule> parseModules(std::string_view text) {
    // name size refcount deps state address
    std::vector<KernelModule> modules;
    forEachLine(text, [&](std::string_view line) {
        std::string_view f[6];
        if (fields(line, f, 6) < 6) {
            return;
        }
        KernelModule module;
        module.name.assign(f[0]);
        if (!decimal(f[1], module.size)) {
            return;
        }
        hex(f[5], module.address);
        modules.push_back(std::move(module));
    });
    return modules;
}

std::vector<MeminfoEntry> parseMeminfo(std::string_view text) {
    std::vector<MeminfoEntry> entries;
    forEachLine(text, [&](std::string_view line) {
        const size_t colon = line.find(':');
        if (colon == std::string_view::npos || colon == 0) {
            return;
        }
        std::string_view f[2];
        const size_t n = fields(line.substr(colon + 1), f, 2);
        uint64_t value = 0;
        if (n < 1 || !decimal(f[0], value)) {
            return;
        }
        if (n == 2 && f[1] == "kB") {
            value *= 1024;
        }
        entries.push_back(MeminfoEntry{std::string(line.substr(0, colon)), value});
    });
    return entries;
}

uint64_t parsePerCpuFreePages(std::string_view zoneinfo) {
    uint64_t pages = 0;
    bool inPagesets = false;
    forEachLine(zoneinfo, [&](std::string_view line) {
        std::string_view f[2];
        const size_t n = fields(line, f, 2);
        if (n == 0) {
            return;
        }
        if (f[0] == "Node") {
            inPagesets = false; // a new zone
        } else if (f[0] == "pagesets") {
            inPagesets = true;
        } else if (inPagesets && f[0] == "count:" && n == 2) {
            uint64_t count = 0;
            if (decimal(f[1], count)) {
                pages += count;
            }
        }
    });
    return pages;
}

KernelBooks closeKernelBooks(const KernelBooksInput &in) {
    auto less = [](uint64_t a, uint64_t b) { return a > b ? a - b : 0; };
    KernelBooks books;
    const uint64_t unreclaimableZones = less(in.zones, in.reclaimableZones);
    books.slabOutsideCachesReclaimable = less(in.sReclaimable, in.reclaimableZones);
    books.slabOutsideCaches = books.slabOutsideCachesReclaimable + less(in.sUnreclaim, unreclaimableZones);

    const uint64_t unmapped = less(in.cached + in.buffers + in.swapCached, in.mapped);
    books.unmappedPageCacheDirty = std::min(in.dirty + in.writeback, unmapped);
    // Shmem counts mapped and unmapped pages alike: at most this much of
    // the unmapped cache is tmpfs, and that much is never called droppable.
    books.unmappedTmpfs = std::min(in.shmem, unmapped - books.unmappedPageCacheDirty);
    books.unmappedPageCache = unmapped - books.unmappedTmpfs;
    books.perCpuFree = in.perCpuFree;
    books.unusedHugetlb = std::min(in.hugetlb, in.hugePagesFree * in.hugePageSize);

    const uint64_t used = less(in.memTotal, in.memFree);
    // Huge pages in use are the processes' (which count them), the rest of
    // the pool is listed here.
    const uint64_t named = in.anonPages + in.mapped + in.zones + in.otherListed + books.slabOutsideCaches +
                           unmapped + books.perCpuFree + in.hugetlb;
    books.unnamed = less(used, named);
    books.unnamedClamped = named > used;
    return books;
}

} // namespace vs
