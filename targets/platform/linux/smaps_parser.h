#pragma once

// Parser for /proc/PID/smaps (and /proc/PID/maps, which is the header lines
// of smaps alone). The text is one header line per mapping
//
//   start-end perms offset major:minor inode    path
//
// followed by "Name:   N kB" field lines and a "VmFlags:" line. Addresses,
// offset and device numbers are hex, the inode is decimal, the path runs to
// the end of the line and may hold blanks, " (deleted)" or a bracketed
// pseudo name. Header lines start with a hex digit, field names with an
// upper-case letter, which is how the two are told apart.
//
// The input may be cut short (a read that raced with the process exiting):
// a line without its terminating newline is ignored, so a half-printed
// number never becomes a wrong size.

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace vs {

// The two-letter VmFlags this program reads, one bit each.
inline constexpr uint64_t kVmRead = 1ull << 0; // rd
inline constexpr uint64_t kVmWrite = 1ull << 1; // wr
inline constexpr uint64_t kVmExec = 1ull << 2; // ex
inline constexpr uint64_t kVmShared = 1ull << 3; // sh
inline constexpr uint64_t kVmMayRead = 1ull << 4; // mr
inline constexpr uint64_t kVmMayWrite = 1ull << 5; // mw
inline constexpr uint64_t kVmMayExec = 1ull << 6; // me
inline constexpr uint64_t kVmMayShare = 1ull << 7; // ms
inline constexpr uint64_t kVmGrowsDown = 1ull << 8; // gd
inline constexpr uint64_t kVmPfnMap = 1ull << 9; // pf
inline constexpr uint64_t kVmLocked = 1ull << 10; // lo
inline constexpr uint64_t kVmIo = 1ull << 11; // io
inline constexpr uint64_t kVmDontCopy = 1ull << 12; // dc
inline constexpr uint64_t kVmDontExpand = 1ull << 13; // de
inline constexpr uint64_t kVmAccount = 1ull << 14; // ac
inline constexpr uint64_t kVmNoReserve = 1ull << 15; // nr
inline constexpr uint64_t kVmHugetlb = 1ull << 16; // ht
inline constexpr uint64_t kVmDontDump = 1ull << 17; // dd
inline constexpr uint64_t kVmMixedMap = 1ull << 18; // mm
inline constexpr uint64_t kVmHugePage = 1ull << 19; // hg
inline constexpr uint64_t kVmNoHugePage = 1ull << 20; // nh
inline constexpr uint64_t kVmMergeable = 1ull << 21; // mg
inline constexpr uint64_t kVmSealed = 1ull << 22; // sl
inline constexpr uint64_t kVmWipeOnFork = 1ull << 23; // wf
inline constexpr uint64_t kVmLockOnFault = 1ull << 24; // lf
inline constexpr uint64_t kVmSoftDirty = 1ull << 25; // sd

// Bit of a two-letter VmFlags name, 0 for names this program ignores.
uint64_t vmFlagBit(char first, char second);

// A size the kernel prints in kB, kept as that count and read as bytes. A
// process may have a million mappings, each with a dozen sizes: 32 bits of
// kB (4 TiB) hold any one mapping's, in half the room of a byte count.
class KilobyteSize {
public:
    constexpr KilobyteSize() = default;
    // Bytes below a whole kB are dropped; beyond 4 TiB the count saturates.
    constexpr KilobyteSize(uint64_t bytes)
        : _kilobytes(bytes / 1024 > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(bytes / 1024)) {}
    constexpr operator uint64_t() const { return uint64_t{_kilobytes} * 1024; }

private:
    uint32_t _kilobytes = 0;
};

// A mapping's path, held once for the whole run however many mappings
// (of however many processes) show it: a pointer to the run-wide copy,
// null for none. Reads as a string_view.
class MappingPath {
public:
    MappingPath() = default;
    MappingPath(std::string_view text);
    MappingPath(const char *text) : MappingPath(std::string_view(text)) {}
    MappingPath(const std::string &text) : MappingPath(std::string_view(text)) {}

    operator std::string_view() const { return _text != nullptr ? std::string_view(*_text) : std::string_view(); }
    const std::string &str() const;
    bool empty() const { return _text == nullptr; }
    size_t size() const { return _text != nullptr ? _text->size() : 0; }
    char operator[](size_t i) const { return (*_text)[i]; }
    friend bool operator==(const MappingPath &a, std::string_view b) { return std::string_view(a) == b; }
    friend bool operator==(const MappingPath &a, const MappingPath &b) {
        return std::string_view(a) == std::string_view(b);
    }

private:
    const std::string *_text = nullptr;
};

// One mapping. Sizes read as bytes (the file prints kB). Kept small: a parse
// holds one per mapping until the walk has passed the last one.
struct SmapsRegion {
    uint64_t start = 0;
    uint64_t end = 0;
    uint64_t offset = 0;
    uint64_t inode = 0;
    uint64_t vmFlags = 0;
    uint32_t devMajor = 0;
    uint32_t devMinor = 0;
    MappingPath path; // as printed, empty for plain anonymous memory

    KilobyteSize rss;
    KilobyteSize sharedClean;
    KilobyteSize sharedDirty;
    KilobyteSize privateClean;
    KilobyteSize privateDirty;
    KilobyteSize lazyFree;
    KilobyteSize anonymous; // anonymous pages, copy-on-write copies of file pages included
    KilobyteSize swap;
    KilobyteSize swapPss;   // below swap when some swap entries are shared
    KilobyteSize privateHugetlb; // hugetlb pages, which Rss leaves out
    KilobyteSize sharedHugetlb;
    KilobyteSize locked;
    bool read = false;
    bool write = false;
    bool exec = false;
    bool shared = false; // 's' in the perms, else 'p'
    bool hasVmFlags = false; // false for maps lines and cut-short records

    uint64_t size() const { return end - start; }
    bool hasFlag(uint64_t bit) const { return (vmFlags & bit) != 0; }
};
static_assert(sizeof(SmapsRegion) <= 112);

// Appends every mapping of `text` to `out` (which is not cleared) and
// returns the number appended. Never fails: unparseable lines are skipped.
size_t parseSmaps(std::string_view text, std::vector<SmapsRegion> &out);

// The same parse over text that arrives in pieces, so that a process with a
// million mappings is parsed through a small buffer instead of holding its
// whole smaps (about 700 bytes a mapping) at once. feed() parses every
// whole line of `text` and returns how many bytes that was; the caller
// keeps the rest and gives it again, followed by what it reads next. The
// region being parsed is out.back() until the next header line.
class SmapsParser {
public:
    explicit SmapsParser(std::vector<SmapsRegion> &out) : _out(out) {}
    size_t feed(std::string_view text);

private:
    std::vector<SmapsRegion> &_out;
    bool _inRegion = false;
};

// A device as one number, major above minor, as the layer keys files.
inline uint64_t deviceNumber(uint32_t majorNumber, uint32_t minorNumber) {
    return (uint64_t{majorNumber} << 32) | minorNumber;
}

// The device under which the layer keys a mapping's object. SysV segments
// live on the shmem device like memfds and shared anonymous memory, but show
// their segment id where those show an inode number: a numbering of its own,
// kept apart so that segment 29 never meets the memfd with inode 29.
inline constexpr uint64_t kSysVSegmentDevice = 1ull << 63;
inline uint64_t objectDevice(const SmapsRegion &region) {
    const uint64_t device = deviceNumber(region.devMajor, region.devMinor);
    return std::string_view(region.path).starts_with("/SYSV") && region.inode != 0 ? device | kSysVSegmentDevice : device;
}

// Parsed regions kept small while they wait (a run holds every target's
// parse until the pages they share are known): variable-length numbers,
// each distinct path once. unpackSmapsRegions gives back exactly what was
// packed.
struct PackedSmapsRegions {
    std::vector<uint8_t> bytes;
    std::vector<MappingPath> paths;
    size_t count = 0;
};
PackedSmapsRegions packSmapsRegions(const std::vector<SmapsRegion> &regions);
void unpackSmapsRegions(const PackedSmapsRegions &packed, std::vector<SmapsRegion> &regions);

// What kind of memory a mapping is, from its path, device and inode. The
// shmem family (tmpfs files, memfd, SysV segments, shared anonymous memory
// shown as "/dev/zero (deleted)") has pages that cannot be dropped, so it
// never counts as backed by an external pager.
enum class MappingKind : uint8_t {
    Anonymous,    // no inode: heap, stacks, private anonymous memory
    File,         // a regular file on a disk file system
    SharedMemory, // shmem family
    Special,      // [vdso], [vvar], [vvar_vclock], [vsyscall]
};

// `tmpfsDevices` are the device numbers (major << 32 | minor) of the mounted
// tmpfs file systems; pass an empty list to recognise shmem by name only.
MappingKind mappingKind(const SmapsRegion &region, const std::vector<uint64_t> &tmpfsDevices);

} // namespace vs
