#pragma once

// Images of a Linux process: every mapped file with an ELF header. Their
// loadable segments come from the program headers, which are read once per
// (device, inode) per run and shared by every process that maps the file.
//
// Where a segment sits in a process: find the PT_LOAD whose page-rounded
// file offset equals the offset of one of the file's mappings; the load
// bias is that mapping's start minus the PT_LOAD's page-rounded vaddr. A
// segment then covers [bias + vaddr, bias + vaddr + memsz), so the
// anonymous .bss tail after the file pages belongs to its image too.

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace vs {

struct SmapsRegion;

struct ElfLoadSegment {
    uint64_t offset = 0;
    uint64_t vaddr = 0;
    uint64_t memsz = 0;
    uint32_t flags = 0; // PF_R / PF_W / PF_X
};

struct ElfProgramInfo {
    bool is64bit = false;
    std::vector<ElfLoadSegment> loads;
    // The PT_GNU_RELRO range (vaddr, memsz); memsz 0 when there is none.
    uint64_t relroVaddr = 0;
    uint64_t relroMemsz = 0;
};

// Parses the ELF header and program headers at the start of a file.
// `bytes` must hold the program header table; `programHeaderEnd` (out) tells
// how many bytes that takes, so a caller that read too little can retry.
// Returns nullopt for files that are not ELF, or when the table lies
// beyond the given bytes (then programHeaderEnd > bytes.size()).
std::optional<ElfProgramInfo> parseElfProgramHeaders(std::string_view bytes,
                                                     uint64_t &programHeaderEnd);

// One named segment of one image in a process.
struct ImageSegment {
    uint64_t start = 0;
    uint64_t size = 0;
    const char *name = ""; // "__TEXT", "__DATA_CONST" or "__DATA"
};

struct ProcessImage {
    std::string path;
    std::vector<ImageSegment> segments;
};

// The segments of an image loaded with the given bias, in vaddr order.
// Writable segments are split where PT_GNU_RELRO ends (rounded down to the
// page, as the loader protects whole pages only): the part inside is
// "__DATA_CONST", the rest "__DATA".
std::vector<ImageSegment> imageSegments(const ElfProgramInfo &info, uint64_t bias,
                                        uint64_t pageSize);

// Load bias of a mapping with file offset `offset` starting at `start`, or
// nullopt when no PT_LOAD starts at that page of the file.
std::optional<uint64_t> loadBias(const ElfProgramInfo &info, uint64_t start, uint64_t offset,
                                 uint64_t pageSize);

// Run-wide, thread-safe cache of program headers by (device, inode). A file
// that is not ELF is remembered as such; a file that could not be read is
// not remembered at all, so a process that exits while its file is read
// costs no other process its image.
class ElfCache {
public:
    using Reader = int64_t (*)(void *context, uint64_t offset, void *out, size_t size);

    // Looks the file up, reading it through `read` (bytes at an offset of
    // the file, or -errno; a short count is the end of the file) on first
    // sight. Returns null for files that are not ELF or cannot be read.
    std::shared_ptr<const ElfProgramInfo> lookup(uint64_t device, uint64_t inode, Reader read,
                                                 void *context);

    static ElfCache &shared();

private:
    struct Key {
        uint64_t device;
        uint64_t inode;
        bool operator==(const Key &) const = default;
    };
    struct KeyHash {
        size_t operator()(const Key &k) const {
            return std::hash<uint64_t>()(k.inode * 0x9E3779B97F4A7C15ull ^ k.device);
        }
    };

    std::mutex _mutex;
    std::unordered_map<Key, std::shared_ptr<const ElfProgramInfo>, KeyHash> _entries;
};

// The images of a process from its parsed mappings: the ELF files it maps
// executable somewhere (no other file is read). `read` is given one mapping
// of such a file and must read bytes of the file at a file offset.
using MappedFileReader = int64_t (*)(void *context, const SmapsRegion &region, uint64_t offset,
                                     void *out, size_t size);

std::vector<ProcessImage> processImages(const std::vector<SmapsRegion> &regions,
                                        uint64_t pageSize, ElfCache &cache,
                                        MappedFileReader read, void *context);

} // namespace vs
