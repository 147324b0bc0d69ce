#include "targets/platform/linux/elf_images.h"

#include "targets/platform/linux/smaps_parser.h"

#include <algorithm>
#include <cstring>
#include <elf.h>
#include <map>
#include <set>

namespace vs {

namespace {

constexpr size_t kFirstRead = 4096;
constexpr uint64_t kMaxProgramHeaderEnd = 1 << 20;

bool hostIsLittleEndian() {
    const uint16_t probe = 1;
    uint8_t first;
    std::memcpy(&first, &probe, 1);
    return first == 1;
}

// a + b, or UINT64_MAX when that does not fit: header fields are input
// from files anyone may have written.
uint64_t saturatingAdd(uint64_t a, uint64_t b) {
    return a > UINT64_MAX - b ? UINT64_MAX : a + b;
}

// Highest address a segment may reach: anything above is no user mapping
// and only a crafted header would claim it.
constexpr uint64_t kAddressLimit = uint64_t{1} << 57;

template <typename Ehdr, typename Phdr>
std::optional<ElfProgramInfo> parseClass(std::string_view bytes, uint64_t &programHeaderEnd) {
    if (bytes.size() < sizeof(Ehdr)) {
        return std::nullopt;
    }
    Ehdr header;
    std::memcpy(&header, bytes.data(), sizeof header);
    if (header.e_phentsize < sizeof(Phdr) || header.e_phnum == 0 ||
        header.e_phnum == PN_XNUM) {
        return std::nullopt;
    }
    // Both factors are 16-bit: the product fits; the offset may not.
    const uint64_t tableOffset = header.e_phoff;
    const uint64_t tableSize = uint64_t{header.e_phnum} * header.e_phentsize;
    programHeaderEnd = saturatingAdd(tableOffset, tableSize);
    if (tableOffset > bytes.size() || tableSize > bytes.size() - tableOffset) {
        return std::nullopt;
    }
    ElfProgramInfo info;
    info.is64bit = sizeof(Ehdr) == sizeof(Elf64_Ehdr);
    for (unsigned i = 0; i < header.e_phnum; ++i) {
        Phdr ph;
        std::memcpy(&ph, bytes.data() + tableOffset + uint64_t{i} * header.e_phentsize, sizeof ph);
        // A segment reaching past the address space belongs to no process.
        if (saturatingAdd(ph.p_vaddr, ph.p_memsz) > kAddressLimit) {
            continue;
        }
        if (ph.p_type == PT_LOAD) {
            info.loads.push_back(ElfLoadSegment{ph.p_offset, ph.p_vaddr, ph.p_memsz, ph.p_flags});
        } else if (ph.p_type == PT_GNU_RELRO) {
            info.relroVaddr = ph.p_vaddr;
            info.relroMemsz = ph.p_memsz;
        }
    }
    if (info.loads.empty()) {
        return std::nullopt;
    }
    std::sort(info.loads.begin(), info.loads.end(),
              [](const ElfLoadSegment &a, const ElfLoadSegment &b) { return a.vaddr < b.vaddr; });
    return info;
}

uint64_t alignDown(uint64_t value, uint64_t pageSize) {
    return value & ~(pageSize - 1);
}

// The program headers of a file; null for a file that is not ELF, nullopt
// when it could not be read (which says nothing about the file).
std::optional<std::shared_ptr<const ElfProgramInfo>> readProgramInfo(ElfCache::Reader read, void *context) {
    std::string bytes(kFirstRead, '\0');
    int64_t n = read(context, 0, bytes.data(), bytes.size());
    if (n < 0) {
        return std::nullopt;
    }
    bytes.resize(static_cast<size_t>(n));
    uint64_t needed = 0;
    auto info = parseElfProgramHeaders(bytes, needed);
    if (!info && needed > bytes.size() && needed <= kMaxProgramHeaderEnd &&
        static_cast<size_t>(n) == kFirstRead) {
        bytes.assign(needed, '\0');
        n = read(context, 0, bytes.data(), bytes.size());
        if (n < 0) {
            return std::nullopt;
        }
        bytes.resize(static_cast<size_t>(n));
        info = parseElfProgramHeaders(bytes, needed);
    }
    if (!info) {
        return std::shared_ptr<const ElfProgramInfo>();
    }
    return std::make_shared<const ElfProgramInfo>(std::move(*info));
}

} // namespace

std::optional<ElfProgramInfo> parseElfProgramHeaders(std::string_view bytes,
                                                     uint64_t &programHeaderEnd) {
    programHeaderEnd = 0;
    if (bytes.size() < EI_NIDENT || std::memcmp(bytes.data(), ELFMAG, SELFMAG) != 0) {
        return std::nullopt;
    }
    const unsigned char data = static_cast<unsigned char>(bytes[EI_DATA]);
    if (data != (hostIsLittleEndian() ? ELFDATA2LSB : ELFDATA2MSB)) {
        return std::nullopt;
    }
    switch (static_cast<unsigned char>(bytes[EI_CLASS])) {
    case ELFCLASS64:
        return parseClass<Elf64_Ehdr, Elf64_Phdr>(bytes, programHeaderEnd);
    case ELFCLASS32:
        return parseClass<Elf32_Ehdr, Elf32_Phdr>(bytes, programHeaderEnd);
    default:
        return std::nullopt;
    }
}

std::vector<ImageSegment> imageSegments(const ElfProgramInfo &info, uint64_t bias,
                                        uint64_t pageSize) {
    std::vector<ImageSegment> segments;
    const uint64_t relroStart = info.relroVaddr;
    const uint64_t relroEnd = alignDown(info.relroVaddr + info.relroMemsz, pageSize);
    for (const ElfLoadSegment &load : info.loads) {
        if (load.memsz == 0) {
            continue;
        }
        const uint64_t start = load.vaddr;
        const uint64_t end = load.vaddr + load.memsz;
        // The bias comes from where the process mapped the file; segments
        // a crafted header places beyond the address space are left out.
        if (saturatingAdd(bias, end) > kAddressLimit) {
            continue;
        }
        if ((load.flags & PF_W) == 0) {
            segments.push_back(ImageSegment{bias + start, load.memsz, "__TEXT"});
            continue;
        }
        if (info.relroMemsz == 0 || relroEnd <= start || relroStart >= end ||
            relroEnd <= relroStart) {
            segments.push_back(ImageSegment{bias + start, load.memsz, "__DATA"});
            continue;
        }
        const uint64_t constStart = std::max(start, relroStart);
        const uint64_t constEnd = std::min(end, relroEnd);
        if (constStart > start) {
            segments.push_back(ImageSegment{bias + start, constStart - start, "__DATA"});
        }
        segments.push_back(ImageSegment{bias + constStart, constEnd - constStart, "__DATA_CONST"});
        if (end > constEnd) {
            segments.push_back(ImageSegment{bias + constEnd, end - constEnd, "__DATA"});
        }
    }
    return segments;
}

std::optional<uint64_t> loadBias(const ElfProgramInfo &info, uint64_t start, uint64_t offset,
                                 uint64_t pageSize) {
    for (const ElfLoadSegment &load : info.loads) {
        if (alignDown(load.offset, pageSize) == offset) {
            return start - alignDown(load.vaddr, pageSize);
        }
    }
    return std::nullopt;
}

std::shared_ptr<const ElfProgramInfo> ElfCache::lookup(uint64_t device, uint64_t inode,
                                                       Reader read, void *context) {
    const Key key{device, inode};
    {
        std::lock_guard<std::mutex> lock(_mutex);
        auto it = _entries.find(key);
        if (it != _entries.end()) {
            return it->second;
        }
    }
    // Read outside the lock: two threads may both read a file the first
    // time, which is cheaper than serialising every first read.
    auto info = readProgramInfo(read, context);
    if (!info) {
        // A read that failed (the process went away while it was read, a
        // file that could not be reached) is asked again next time.
        return nullptr;
    }
    std::lock_guard<std::mutex> lock(_mutex);
    auto [it, inserted] = _entries.try_emplace(key, std::move(*info));
    return it->second;
}

ElfCache &ElfCache::shared() {
    static ElfCache cache;
    return cache;
}

namespace {

struct RegionReadContext {
    MappedFileReader read;
    void *context;
    const SmapsRegion *region;
};

int64_t readThroughRegion(void *context, uint64_t offset, void *out, size_t size) {
    auto *c = static_cast<RegionReadContext *>(context);
    return c->read(c->context, *c->region, offset, out, size);
}

} // namespace

std::vector<ProcessImage> processImages(const std::vector<SmapsRegion> &regions,
                                        uint64_t pageSize, ElfCache &cache,
                                        MappedFileReader read, void *context) {
    std::vector<ProcessImage> images;
    // Per file, the address span [first, last) of each image found so far:
    // later mappings of an image (its relro and data pages) fall inside it
    // and need no bias of their own.
    std::map<std::pair<uint64_t, uint64_t>, std::vector<std::pair<uint64_t, uint64_t>>> spans;
    // Only a file the process maps executable somewhere can be an image:
    // no other file is ever read.
    std::set<std::pair<uint64_t, uint64_t>> executableFiles;
    for (const SmapsRegion &region : regions) {
        if (region.exec && region.inode != 0) {
            executableFiles.emplace(deviceNumber(region.devMajor, region.devMinor), region.inode);
        }
    }
    for (const SmapsRegion &region : regions) {
        if (region.inode == 0 || region.path.empty() || region.path[0] != '/') {
            continue;
        }
        const uint64_t device = deviceNumber(region.devMajor, region.devMinor);
        if (executableFiles.count({device, region.inode}) == 0) {
            continue;
        }
        auto &fileSpans = spans[{device, region.inode}];
        const bool covered =
            std::any_of(fileSpans.begin(), fileSpans.end(), [&](const auto &span) {
                return span.first <= region.start && region.start < span.second;
            });
        if (covered) {
            continue;
        }
        RegionReadContext readContext{read, context, &region};
        auto info = cache.lookup(device, region.inode, readThroughRegion, &readContext);
        if (!info) {
            continue;
        }
        const auto bias = loadBias(*info, region.start, region.offset, pageSize);
        if (!bias) {
            continue;
        }
        ProcessImage image{region.path.str(), imageSegments(*info, *bias, pageSize)};
        if (image.segments.empty()) {
            continue;
        }
        const uint64_t first = image.segments.front().start;
        const uint64_t last = image.segments.back().start + image.segments.back().size;
        fileSpans.emplace_back(std::min(first, region.start), last);
        images.push_back(std::move(image));
    }
    return images;
}

} // namespace vs
