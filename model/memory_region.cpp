#include "model/memory_region.h"

#include <array>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

#include "model/assert.h"

namespace {

const std::string *internedOrNull(const std::optional<std::string> &text) {
    return text ? vs::internedString(*text) : nullptr;
}

std::optional<std::string> copyOf(const std::string *text) {
    return text != nullptr ? std::optional<std::string>(*text) : std::nullopt;
}

// The run-wide table of shared strings. Each thread keeps its own index of
// the strings it has seen, so that the gathering threads, which name every
// region, only take the lock for a text new to them.
struct StringPool {
    std::mutex lock;
    std::unordered_map<std::string_view, std::unique_ptr<const std::string>> strings;
};

StringPool &stringPool() {
    static StringPool *pool = new StringPool; // never destroyed: regions may outlive static teardown
    return *pool;
}

// Slot 0 and 240-255 are never consulted. Slots 1-239 that are empty fall
// back to "tag %d". The Linux layer assigns the platform slots (20, 21, 33,
// 34, 40-46, 50-58, ...) from what /proc tells about a mapping.
constexpr std::array<const char *, 256> makeUserTagTable() {
    std::array<const char *, 256> t{};
    t[1] = "malloc metadata";
    t[2] = "MALLOC_SMALL";
    t[3] = "MALLOC_LARGE";
    t[4] = "MALLOC_HUGE";
    t[5] = "sbrk";
    t[6] = "realloc";
    t[7] = "MALLOC_TINY";
    t[8] = "MALLOC_LARGE_REUSABLE";
    t[9] = "MALLOC_LARGE_REUSED";
    t[10] = "performance tool data";
    t[11] = "MALLOC_NANO";
    t[18] = "system/kernel diagnostics";
    t[20] = "ld.so";
    t[21] = "shared memory";
    t[30] = "stack";
    t[31] = "guard";
    t[32] = "shared pmap";
    t[33] = "vdso";
    t[34] = "vvar";
    t[35] = "unshared pmap";
    t[40] = "vsyscall";
    t[41] = "JIT code";
    t[42] = "glibc malloc arena";
    t[43] = "memfd";
    t[44] = "SysV shared memory";
    t[45] = "POSIX shared memory";
    t[46] = "/dev/zero mapping";
    t[50] = "JVM heap";
    t[51] = "JVM metaspace";
    t[52] = "JVM code cache";
    t[53] = "V8 heap";
    t[54] = "V8 code space";
    t[55] = "Go heap";
    t[56] = "Python obmalloc";
    t[57] = ".NET GC heap";
    t[58] = "Erlang VM";
    t[60] = "jemalloc";
    t[61] = "tcmalloc";
    t[62] = "SQLite page cache";
    t[63] = "WebAssembly";
    t[64] = "JS JIT generated code";
    t[65] = "JS VM register file";
    t[66] = "OpenGL Shading Language";
    t[67] = "mimalloc";
    t[68] = "musl malloc";
    t[69] = "Wayland shm buffer";
    t[70] = "X11 MIT-SHM";
    t[71] = "Mesa";
    t[72] = "GPU driver";
    t[73] = "PulseAudio";
    t[74] = "PipeWire";
    t[75] = "GLib slice";
    t[76] = "Qt";
    t[77] = "GTK";
    t[78] = "io_uring";
    t[79] = "perf ring buffer";
    t[80] = "corpse info";
    t[81] = "BPF map";
    t[82] = "dma-buf";
    t[83] = "hugetlbfs";
    t[84] = "userfaultfd";
    t[86] = "uprobes";
    t[87] = "Ruby heap";
    t[88] = "Lua";
    t[89] = "PartitionAlloc";
    t[90] = "audio";
    t[91] = "video bitstream";
    t[92] = "ALSA";
    t[93] = "CUDA";
    t[94] = "OpenCL";
    t[95] = "Vulkan";
    t[96] = "Dart VM";
    t[97] = "Wine";
    t[98] = "sanitizer shadow";
    return t;
}

constexpr std::array<const char *, 256> kUserTagTable = makeUserTagTable();

struct DynamicTagRegistry {
    std::mutex lock;
    std::unordered_map<std::string, std::uint32_t> tagForName;
    std::vector<std::string> names; // index = tag - kFirstDynamicTag
};

DynamicTagRegistry &dynamicTags() {
    static DynamicTagRegistry registry;
    return registry;
}

std::string formatWithNumber(const char *format, int number) {
    char buffer[48];
    std::snprintf(buffer, sizeof buffer, format, number);
    return buffer;
}

} // namespace

VSMemoryRegion::VSMemoryRegion(const VSMemoryRegion &other)
    : _memoryObject(other._memoryObject),
      _name(other.sharedName()),
      _detailedName(other.sharedDetailedName()),
      _offset(other._offset),
      _start(other._start),
      _size(other._size),
      _dirtySize(other._dirtySize),
      _reclaimableSize(other._reclaimableSize),
      _swappedSize(other._swappedSize),
      _cleanNonSpecSize(other._cleanNonSpecSize),
      _wiredSize(other._wiredSize),
      _object_id(other._object_id),
      _user_tag(other._user_tag),
      _segment(other._segment),
      _share_mode(other._share_mode),
      _inSharedCache(other._inSharedCache),
      _unusedSharedCacheRegion(other._unusedSharedCacheRegion),
      _purgeableNonVolatile(other._purgeableNonVolatile) {}

VSMemoryRegion &VSMemoryRegion::operator=(const VSMemoryRegion &other) {
    if (this == &other) {
        return *this;
    }
    setSharedName(other.sharedName());
    setSharedDetailedName(other.sharedDetailedName());
    _memoryObject = other._memoryObject;
    _offset = other._offset;
    _start = other._start;
    _size = other._size;
    _dirtySize = other._dirtySize;
    _reclaimableSize = other._reclaimableSize;
    _swappedSize = other._swappedSize;
    _cleanNonSpecSize = other._cleanNonSpecSize;
    _wiredSize = other._wiredSize;
    _object_id = other._object_id;
    _user_tag = other._user_tag;
    _segment = other._segment;
    _share_mode = other._share_mode;
    _inSharedCache = other._inSharedCache;
    _unusedSharedCacheRegion = other._unusedSharedCacheRegion;
    _purgeableNonVolatile = other._purgeableNonVolatile;
    return *this;
}

std::optional<std::string> VSMemoryRegion::name() const { return copyOf(sharedName()); }

void VSMemoryRegion::setName(std::optional<std::string> name) { setSharedName(internedOrNull(name)); }

std::optional<std::string> VSMemoryRegion::detailedName() const { return copyOf(sharedDetailedName()); }

void VSMemoryRegion::setDetailedName(std::optional<std::string> detailedName) {
    setSharedDetailedName(internedOrNull(detailedName));
}

void VSMemoryRegion::setEnd(std::uint64_t end) {
    VS_ASSERT_MSG(end >= _start, "end >= self.start");
    _size = end - _start;
}

std::int64_t VSMemoryRegion::compare(const VSMemoryRegion &other) const {
    if (_start < other._start) {
        return -1;
    }
    if (_start > other._start) {
        return 1;
    }
    if (_size > other._size) {
        return -1;
    }
    if (_size < other._size) {
        return 1;
    }
    return 0;
}

std::optional<std::string> VSMemoryRegion::categoryNameForTag(std::uint32_t tag) {
    if (tag == 0) {
        return std::nullopt;
    }
    if ((tag & ~0xFu) == vs::kTagAppSpecificFirst) {
        return formatWithNumber("app-specific tag %d", static_cast<int>(tag) - 239);
    }
    if (tag < vs::kTagAppSpecificFirst) {
        if (const char *text = kUserTagTable[tag]) {
            return std::string(text);
        }
    } else if (tag == vs::kTagNonVolatilePhysVestage) {
        return std::string("Non-volatile physical vestage");
    } else if (auto registered = vs::dynamicTagName(tag)) {
        return registered;
    }
    return formatWithNumber("tag %d", static_cast<std::int32_t>(tag));
}

namespace vs {

const char *userTagTableName(std::uint32_t tag) {
    return tag < kUserTagTable.size() ? kUserTagTable[tag] : nullptr;
}

std::uint32_t registerDynamicTagName(const std::string &name) {
    DynamicTagRegistry &registry = dynamicTags();
    std::lock_guard guard(registry.lock);
    auto found = registry.tagForName.find(name);
    if (found != registry.tagForName.end()) {
        return found->second;
    }
    // Leave the all-ones tag alone; it has a fixed meaning.
    VS_ASSERT(registry.names.size() < kTagNonVolatilePhysVestage - kFirstDynamicTag);
    auto tag = static_cast<std::uint32_t>(kFirstDynamicTag + registry.names.size());
    registry.names.push_back(name);
    registry.tagForName.emplace(name, tag);
    return tag;
}

const std::string *internedString(std::string_view text) {
    thread_local std::unordered_map<std::string_view, const std::string *> seen;
    if (auto found = seen.find(text); found != seen.end()) {
        return found->second;
    }
    StringPool &pool = stringPool();
    const std::string *shared;
    {
        std::lock_guard guard(pool.lock);
        auto found = pool.strings.find(text);
        if (found == pool.strings.end()) {
            auto copy = std::make_unique<const std::string>(text);
            const std::string_view key = *copy;
            found = pool.strings.emplace(key, std::move(copy)).first;
        }
        shared = found->second.get();
    }
    seen.emplace(*shared, shared);
    return shared;
}

std::optional<std::string> dynamicTagName(std::uint32_t tag) {
    if (tag < kFirstDynamicTag) {
        return std::nullopt;
    }
    DynamicTagRegistry &registry = dynamicTags();
    std::lock_guard guard(registry.lock);
    std::size_t index = tag - kFirstDynamicTag;
    if (index >= registry.names.size()) {
        return std::nullopt;
    }
    return registry.names[index];
}

} // namespace vs

std::string VSMemoryRegion::sharedMemoryCategoryName(std::string_view path) {
    constexpr std::string_view kDeleted = " (deleted)";
    if (path.size() > kDeleted.size() && path.substr(path.size() - kDeleted.size()) == kDeleted) {
        path.remove_suffix(kDeleted.size());
    }
    std::string name = "shared memory ";
    if (path.rfind("/memfd:", 0) == 0) {
        name += path.substr(1);
    } else if (path.rfind("/SYSV", 0) == 0 && path.size() == 13) {
        // SysV segments are named after their key.
        name += std::string(path.substr(1)) + " (key 0x" + std::string(path.substr(5)) + ")";
    } else {
        name += path;
    }
    return name;
}
