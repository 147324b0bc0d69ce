#include "targets/platform/linux/smaps_parser.h"

#include "model/memory_region.h"
#include "targets/platform/linux/packed_numbers.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>

namespace vs {

MappingPath::MappingPath(std::string_view text) : _text(text.empty() ? nullptr : internedString(text)) {}

const std::string &MappingPath::str() const {
    static const std::string none;
    return _text != nullptr ? *_text : none;
}

namespace {

int hexValue(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    if (c >= 'A' && c <= 'F') {
        return c - 'A' + 10;
    }
    return -1;
}

// A cursor over one line. Every reader stops at the line's end, so a short
// line can only leave fields at their defaults.
struct LineCursor {
    const char *p;
    const char *end;

    bool atEnd() const { return p >= end; }
    void skipBlanks() {
        // The kernel pads columns with runs of blanks: step over eight at a
        // time while it can.
        constexpr uint64_t kEightBlanks = 0x2020202020202020ull;
        uint64_t word;
        while (end - p >= 8 && (std::memcpy(&word, p, 8), word == kEightBlanks)) {
            p += 8;
        }
        while (p < end && (*p == ' ' || *p == '\t')) {
            ++p;
        }
    }
    bool expect(char c) {
        if (p < end && *p == c) {
            ++p;
            return true;
        }
        return false;
    }
    bool hex(uint64_t &value) {
        const char *first = p;
        uint64_t v = 0;
        int digit;
        while (p < end && (digit = hexValue(*p)) >= 0) {
            v = (v << 4) | static_cast<uint64_t>(digit);
            ++p;
        }
        value = v;
        return p != first;
    }
    bool decimal(uint64_t &value) {
        const char *first = p;
        uint64_t v = 0;
        while (p < end && *p >= '0' && *p <= '9') {
            v = v * 10 + static_cast<uint64_t>(*p - '0');
            ++p;
        }
        value = v;
        return p != first;
    }
};

bool parseHeader(LineCursor c, SmapsRegion &r) {
    uint64_t major = 0;
    uint64_t minor = 0;
    if (!c.hex(r.start) || !c.expect('-') || !c.hex(r.end) || !c.expect(' ')) {
        return false;
    }
    if (c.end - c.p < 4) {
        return false;
    }
    r.read = c.p[0] == 'r';
    r.write = c.p[1] == 'w';
    r.exec = c.p[2] == 'x';
    r.shared = c.p[3] == 's';
    c.p += 4;
    c.skipBlanks();
    if (!c.hex(r.offset)) {
        return false;
    }
    c.skipBlanks();
    if (!c.hex(major) || !c.expect(':') || !c.hex(minor)) {
        return false;
    }
    r.devMajor = static_cast<uint32_t>(major);
    r.devMinor = static_cast<uint32_t>(minor);
    c.skipBlanks();
    if (!c.decimal(r.inode)) {
        return false;
    }
    // The path column is padded with blanks; the path itself keeps its own.
    c.skipBlanks();
    r.path = MappingPath(std::string_view(c.p, static_cast<size_t>(c.end - c.p)));
    return r.end >= r.start;
}

// "Name:   123 kB" -> 123 * 1024. The cursor stands after the colon.
uint64_t kilobytes(LineCursor c) {
    c.skipBlanks();
    uint64_t value = 0;
    c.decimal(value);
    return value * 1024;
}

void parseVmFlags(LineCursor c, SmapsRegion &r) {
    uint64_t bits = 0;
    for (;;) {
        c.skipBlanks();
        if (c.end - c.p < 2) {
            break;
        }
        const char *word = c.p;
        while (c.p < c.end && *c.p != ' ') {
            ++c.p;
        }
        if (c.p - word == 2) {
            bits |= vmFlagBit(word[0], word[1]);
        }
    }
    r.vmFlags = bits;
    r.hasVmFlags = true;
}

// True when the line starts with `name` (which ends in its colon).
template <size_t N>
bool hasName(const char *line, const char *lineEnd, const char (&name)[N]) {
    constexpr size_t length = N - 1;
    return static_cast<size_t>(lineEnd - line) >= length && std::memcmp(line, name, length) == 0;
}

// One "Name: value" line. The first letter picks the few names it can be;
// every process prints about twenty-five of these per mapping, so this is
// the parser's inner loop.
void parseField(const char *line, const char *lineEnd, SmapsRegion &r) {
    auto value = [&](size_t nameLength) { return kilobytes(LineCursor{line + nameLength, lineEnd}); };
    switch (line[0]) {
    case 'R':
        if (hasName(line, lineEnd, "Rss:")) {
            r.rss = value(4);
        }
        break;
    case 'S':
        if (hasName(line, lineEnd, "Shared_Clean:")) {
            r.sharedClean = value(13);
        } else if (hasName(line, lineEnd, "Shared_Dirty:")) {
            r.sharedDirty = value(13);
        } else if (hasName(line, lineEnd, "Swap:")) {
            r.swap = value(5);
        } else if (hasName(line, lineEnd, "SwapPss:")) {
            r.swapPss = value(8);
        } else if (hasName(line, lineEnd, "Shared_Hugetlb:")) {
            r.sharedHugetlb = value(15);
        }
        break;
    case 'P':
        if (hasName(line, lineEnd, "Private_Clean:")) {
            r.privateClean = value(14);
        } else if (hasName(line, lineEnd, "Private_Dirty:")) {
            r.privateDirty = value(14);
        } else if (hasName(line, lineEnd, "Private_Hugetlb:")) {
            r.privateHugetlb = value(16);
        }
        break;
    case 'A':
        if (hasName(line, lineEnd, "Anonymous:")) {
            r.anonymous = value(10);
        }
        break;
    case 'L':
        if (hasName(line, lineEnd, "LazyFree:")) {
            r.lazyFree = value(9);
        } else if (hasName(line, lineEnd, "Locked:")) {
            r.locked = value(7);
        }
        break;
    case 'V':
        if (hasName(line, lineEnd, "VmFlags:")) {
            parseVmFlags(LineCursor{line + 8, lineEnd}, r);
        }
        break;
    default:
        break;
    }
}

} // namespace

namespace {

struct NamedFlag {
    const char name[3];
    uint64_t bit;
};

constexpr NamedFlag kNamedFlags[] = {
        {"rd", kVmRead},
        {"wr", kVmWrite},
        {"ex", kVmExec},
        {"sh", kVmShared},
        {"mr", kVmMayRead},
        {"mw", kVmMayWrite},
        {"me", kVmMayExec},
        {"ms", kVmMayShare},
        {"gd", kVmGrowsDown},
        {"pf", kVmPfnMap},
        {"lo", kVmLocked},
        {"io", kVmIo},
        {"dc", kVmDontCopy},
        {"de", kVmDontExpand},
        {"ac", kVmAccount},
        {"nr", kVmNoReserve},
        {"ht", kVmHugetlb},
        {"dd", kVmDontDump},
        {"mm", kVmMixedMap},
        {"hg", kVmHugePage},
        {"nh", kVmNoHugePage},
        {"mg", kVmMergeable},
        {"sl", kVmSealed},
        {"wf", kVmWipeOnFork},
        {"lf", kVmLockOnFault},
        {"sd", kVmSoftDirty},
};

constexpr size_t flagSlot(char first, char second) {
    return static_cast<size_t>(first - 'a') * 26 + static_cast<size_t>(second - 'a');
}

// Every two-letter name maps to one slot of a 26 x 26 table.
constexpr std::array<uint64_t, 26 * 26> makeFlagTable() {
    std::array<uint64_t, 26 * 26> table{};
    for (const NamedFlag &flag : kNamedFlags) {
        table[flagSlot(flag.name[0], flag.name[1])] = flag.bit;
    }
    return table;
}

constexpr std::array<uint64_t, 26 * 26> kFlagTable = makeFlagTable();

} // namespace

uint64_t vmFlagBit(char first, char second) {
    if (first < 'a' || first > 'z' || second < 'a' || second > 'z') {
        return 0;
    }
    return kFlagTable[flagSlot(first, second)];
}

namespace {

// The first newline in [p, end), or null. Lines are short (a field line is
// 28 bytes), so a library call per line costs more than the search: eight
// bytes are tested at a time instead.
const char *findNewline(const char *p, const char *end) {
    if constexpr (std::endian::native == std::endian::little) {
        constexpr uint64_t kNewlines = 0x0A0A0A0A0A0A0A0Aull;
        constexpr uint64_t kLow = 0x0101010101010101ull;
        constexpr uint64_t kHigh = 0x8080808080808080ull;
        auto newlineBytes = [&](const char *at) {
            uint64_t word;
            std::memcpy(&word, at, 8);
            const uint64_t x = word ^ kNewlines; // a newline byte becomes zero
            return (x - kLow) & ~x & kHigh;
        };
        // Nearly every line is a field line of 28 bytes ending in " kB":
        // test for exactly that first, without a branch per word.
        constexpr uint32_t kUnitAndNewline = 0x0A426B20u; // " kB\n"
        uint32_t tail;
        if (end - p >= 32 && (std::memcpy(&tail, p + 24, 4), tail == kUnitAndNewline) &&
            (newlineBytes(p) | newlineBytes(p + 8) | newlineBytes(p + 16)) == 0) {
            return p + 27;
        }
        while (end - p >= 8) {
            const uint64_t zero = newlineBytes(p);
            if (zero != 0) {
                return p + (std::countr_zero(zero) >> 3);
            }
            p += 8;
        }
    }
    return static_cast<const char *>(std::memchr(p, '\n', static_cast<size_t>(end - p)));
}

} // namespace

size_t SmapsParser::feed(std::string_view text) {
    const char *p = text.data();
    const char *const end = p + text.size();
    while (p < end) {
        const char *newline = findNewline(p, end);
        if (newline == nullptr) {
            break; // the rest of the line has not arrived (or never will)
        }
        const char *line = p;
        p = newline + 1;
        if (line == newline) {
            continue;
        }
        const char first = *line;
        if ((first >= '0' && first <= '9') || (first >= 'a' && first <= 'f')) {
            SmapsRegion &region = _out.emplace_back();
            _inRegion = parseHeader(LineCursor{line, newline}, region);
            if (!_inRegion) {
                _out.pop_back();
            }
        } else if (_inRegion && first >= 'A' && first <= 'Z') {
            parseField(line, newline, _out.back());
        }
    }
    return static_cast<size_t>(p - text.data());
}

size_t parseSmaps(std::string_view text, std::vector<SmapsRegion> &out) {
    const size_t before = out.size();
    SmapsParser(out).feed(text);
    return out.size() - before;
}

namespace {

bool startsWith(std::string_view s, std::string_view prefix) {
    return s.size() >= prefix.size() && s.compare(0, prefix.size(), prefix) == 0;
}

} // namespace

MappingKind mappingKind(const SmapsRegion &region, const std::vector<uint64_t> &tmpfsDevices) {
    const std::string_view path = region.path;
    if (region.inode == 0) {
        if (path == "[vdso]" || path == "[vvar]" || path == "[vvar_vclock]" ||
            path == "[vsyscall]") {
            return MappingKind::Special;
        }
        if (startsWith(path, "[anon_shmem:")) {
            return MappingKind::SharedMemory;
        }
        return MappingKind::Anonymous;
    }
    // Shared anonymous memory, memfd and SysV segments live on the kernel's
    // internal shmem mount and are shown under these names.
    if (startsWith(path, "/dev/zero (deleted)") || startsWith(path, "/memfd:") ||
        startsWith(path, "/SYSV") || startsWith(path, "/dev/shm/") ||
        startsWith(path, "[anon_shmem:")) {
        return MappingKind::SharedMemory;
    }
    const uint64_t device = deviceNumber(region.devMajor, region.devMinor);
    if (std::find(tmpfsDevices.begin(), tmpfsDevices.end(), device) != tmpfsDevices.end()) {
        return MappingKind::SharedMemory;
    }
    return MappingKind::File;
}

namespace {



// The counters of a region, in packing order.
template <class Region, class Visit>
void forEachCounter(Region &r, Visit visit) {
    for (auto *field : {&r.rss, &r.sharedClean, &r.sharedDirty, &r.privateClean, &r.privateDirty, &r.lazyFree,
                        &r.anonymous, &r.swap, &r.swapPss, &r.privateHugetlb, &r.sharedHugetlb, &r.locked}) {
        visit(*field);
    }
}

} // namespace

PackedSmapsRegions packSmapsRegions(const std::vector<SmapsRegion> &regions) {
    PackedSmapsRegions packed;
    packed.count = regions.size();
    packed.bytes.reserve(regions.size() * 24);
    std::vector<uint64_t> recent; // indexes of recent paths: a process has few distinct ones
    uint64_t previousEnd = 0;
    for (const SmapsRegion &r : regions) {
        // Mappings come in address order: the gap to the previous end is small.
        vs::putPackedNumber(packed.bytes, r.start - previousEnd);
        vs::putPackedNumber(packed.bytes, r.end - r.start);
        vs::putPackedNumber(packed.bytes, r.offset);
        vs::putPackedNumber(packed.bytes, r.inode);
        vs::putPackedNumber(packed.bytes, r.devMajor);
        vs::putPackedNumber(packed.bytes, r.devMinor);
        vs::putPackedNumber(packed.bytes, (r.read ? 1u : 0u) | (r.write ? 2u : 0u) | (r.exec ? 4u : 0u) | (r.shared ? 8u : 0u) |
                                    (r.hasVmFlags ? 16u : 0u));
        uint64_t pathIndex = 0; // 0: no path
        if (!r.path.empty()) {
            const auto found = std::find_if(recent.begin(), recent.end(),
                                            [&](uint64_t index) { return packed.paths[index - 1] == r.path; });
            if (found != recent.end()) {
                pathIndex = *found;
            } else {
                packed.paths.push_back(r.path);
                pathIndex = packed.paths.size();
                recent.push_back(pathIndex);
                if (recent.size() > 64) {
                    recent.erase(recent.begin());
                }
            }
        }
        vs::putPackedNumber(packed.bytes, pathIndex);
        forEachCounter(r, [&](const KilobyteSize &value) { vs::putPackedNumber(packed.bytes, uint64_t{value} / 1024); });
        vs::putPackedNumber(packed.bytes, r.vmFlags);
        previousEnd = r.end;
    }
    packed.bytes.shrink_to_fit();
    return packed;
}

void unpackSmapsRegions(const PackedSmapsRegions &packed, std::vector<SmapsRegion> &regions) {
    regions.clear();
    regions.reserve(packed.count);
    size_t at = 0;
    uint64_t previousEnd = 0;
    for (size_t i = 0; i < packed.count; ++i) {
        SmapsRegion r;
        r.start = previousEnd + vs::takePackedNumber(packed.bytes, at);
        r.end = r.start + vs::takePackedNumber(packed.bytes, at);
        r.offset = vs::takePackedNumber(packed.bytes, at);
        r.inode = vs::takePackedNumber(packed.bytes, at);
        r.devMajor = static_cast<uint32_t>(vs::takePackedNumber(packed.bytes, at));
        r.devMinor = static_cast<uint32_t>(vs::takePackedNumber(packed.bytes, at));
        const uint64_t bits = vs::takePackedNumber(packed.bytes, at);
        r.read = (bits & 1) != 0;
        r.write = (bits & 2) != 0;
        r.exec = (bits & 4) != 0;
        r.shared = (bits & 8) != 0;
        r.hasVmFlags = (bits & 16) != 0;
        const uint64_t pathIndex = vs::takePackedNumber(packed.bytes, at);
        if (pathIndex != 0 && pathIndex <= packed.paths.size()) {
            r.path = packed.paths[pathIndex - 1];
        }
        forEachCounter(r, [&](KilobyteSize &value) { value = vs::takePackedNumber(packed.bytes, at) * 1024; });
        r.vmFlags = vs::takePackedNumber(packed.bytes, at);
        previousEnd = r.end;
        regions.push_back(std::move(r));
    }
}

} // namespace vs
