#include "targets/platform/linux/smaps_parser.h"

#include <algorithm>
#include <array>

namespace vs {

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
    r.path.assign(c.p, static_cast<size_t>(c.end - c.p));
    return r.end >= r.start;
}

// "Name:   123 kB" -> 123 * 1024. The caller has matched the name already.
uint64_t kilobytes(LineCursor c) {
    c.skipBlanks();
    uint64_t value = 0;
    c.decimal(value);
    return value * 1024;
}

bool nameIs(std::string_view line, std::string_view name) {
    return line.size() > name.size() && line.compare(0, name.size(), name) == 0 &&
           line[name.size()] == ':';
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

void parseField(std::string_view line, LineCursor c, SmapsRegion &r) {
    // Dispatch on the first letter, then compare the few names it can be.
    switch (line[0]) {
    case 'R':
        if (nameIs(line, "Rss")) {
            c.p += 4;
            r.rss = kilobytes(c);
        }
        break;
    case 'S':
        if (nameIs(line, "Shared_Clean")) {
            c.p += 13;
            r.sharedClean = kilobytes(c);
        } else if (nameIs(line, "Shared_Dirty")) {
            c.p += 13;
            r.sharedDirty = kilobytes(c);
        } else if (nameIs(line, "Swap")) {
            c.p += 5;
            r.swap = kilobytes(c);
        }
        break;
    case 'P':
        if (nameIs(line, "Private_Clean")) {
            c.p += 14;
            r.privateClean = kilobytes(c);
        } else if (nameIs(line, "Private_Dirty")) {
            c.p += 14;
            r.privateDirty = kilobytes(c);
        }
        break;
    case 'L':
        if (nameIs(line, "LazyFree")) {
            c.p += 9;
            r.lazyFree = kilobytes(c);
        } else if (nameIs(line, "Locked")) {
            c.p += 7;
            r.locked = kilobytes(c);
        }
        break;
    case 'V':
        if (nameIs(line, "VmFlags")) {
            c.p += 8;
            parseVmFlags(c, r);
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

size_t parseSmaps(std::string_view text, std::vector<SmapsRegion> &out) {
    const size_t before = out.size();
    bool inRegion = false;
    size_t pos = 0;
    while (pos < text.size()) {
        const size_t newline = text.find('\n', pos);
        if (newline == std::string_view::npos) {
            break; // cut short: the last line is incomplete
        }
        const std::string_view line = text.substr(pos, newline - pos);
        pos = newline + 1;
        if (line.empty()) {
            continue;
        }
        LineCursor cursor{line.data(), line.data() + line.size()};
        const char first = line[0];
        if (hexValue(first) >= 0 && !(first >= 'A' && first <= 'F')) {
            SmapsRegion region;
            if (parseHeader(cursor, region)) {
                out.push_back(std::move(region));
                inRegion = true;
            } else {
                inRegion = false;
            }
        } else if (inRegion && first >= 'A' && first <= 'Z') {
            parseField(line, cursor, out.back());
        }
    }
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
    const uint64_t device = (static_cast<uint64_t>(region.devMajor) << 32) | region.devMinor;
    if (std::find(tmpfsDevices.begin(), tmpfsDevices.end(), device) != tmpfsDevices.end()) {
        return MappingKind::SharedMemory;
    }
    return MappingKind::File;
}

} // namespace vs
