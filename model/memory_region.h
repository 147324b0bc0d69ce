#pragma once

// One contiguous range of a target's address space (or one kernel zone or
// wired-memory site) with the bytes of each page class found in it.
//
// Regions are owned by their target (std::unique_ptr in the target's list);
// the memory object a region is merged into refers to it without owning it,
// and the region points back through a plain non-owning pointer.
//
// name and detailedName may be replaced while another thread reads them:
// a reader gets either the whole old or the whole new string. Both are
// kept as pointers to run-wide shared copies (vs::internedString), swapped
// atomically: a run has many thousands of regions and only a few hundred
// distinct names, so no region holds a string, an allocation or a lock of
// its own.

#include <atomic>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "model/block_pool.h"

class VSMemoryObject;

// Which kind of image segment a range belongs to. Kinds 2 to 4 are the
// image-segment kinds.
enum VSSegmentKind : std::uint8_t {
    VSSegmentUnknown = 0,  // never matched against images, or an unrecognised segment
    VSSegmentNone = 1,     // matched, and no image covers it
    VSSegmentText = 2,     // "__TEXT"
    VSSegmentData = 3,     // any segment name beginning with "__DATA"
    VSSegmentLinkedit = 4, // "__LINKEDIT"
};

class VSMemoryRegion {
public:
    // A run makes one per mapping of every target: they come from a pool.
    static void *operator new(std::size_t size) { return vs::BlockPool<VSMemoryRegion>::allocate(size); }
    static void operator delete(void *p, std::size_t size) { vs::BlockPool<VSMemoryRegion>::deallocate(p, size); }

    VSMemoryRegion() = default;
    // Copies every property, memoryObject included (gatherers clone a
    // region before cutting it into pieces).
    VSMemoryRegion(const VSMemoryRegion &other);
    VSMemoryRegion &operator=(const VSMemoryRegion &other);

    // Set by the driver after merging; null before that.
    VSMemoryObject *memoryObject() const { return _memoryObject; }
    void setMemoryObject(VSMemoryObject *object) { _memoryObject = object; }

    // Category name; nullopt when never set.
    std::optional<std::string> name() const;
    void setName(std::optional<std::string> name);

    // Text printed after the name in the region listing; may be absent.
    std::optional<std::string> detailedName() const;
    void setDetailedName(std::optional<std::string> detailedName);

    // The same two texts without a copy: the run-wide shared string
    // (vs::internedString), or null when absent.
    const std::string *sharedName() const { return _name.load(std::memory_order_acquire); }
    void setSharedName(const std::string *name) { _name.store(name, std::memory_order_release); }
    const std::string *sharedDetailedName() const { return _detailedName.load(std::memory_order_acquire); }
    void setSharedDetailedName(const std::string *name) { _detailedName.store(name, std::memory_order_release); }

    std::uint64_t offset() const { return _offset; }
    void setOffset(std::uint64_t offset) { _offset = offset; }

    std::uint64_t start() const { return _start; }
    void setStart(std::uint64_t start) { _start = start; }

    std::uint64_t size() const { return _size; }
    void setSize(std::uint64_t size) { _size = size; }

    // start + size; no storage of its own.
    std::uint64_t end() const { return _start + _size; }
    // Sets size = end - start, keeping start. end below start aborts.
    void setEnd(std::uint64_t end);

    VSSegmentKind segment() const { return _segment; }
    void setSegment(VSSegmentKind segment) { _segment = segment; }

    std::uint64_t dirtySize() const { return _dirtySize; }
    void setDirtySize(std::uint64_t v) { _dirtySize = v; }

    std::uint64_t reclaimableSize() const { return _reclaimableSize; }
    void setReclaimableSize(std::uint64_t v) { _reclaimableSize = v; }

    std::uint64_t swappedSize() const { return _swappedSize; }
    void setSwappedSize(std::uint64_t v) { _swappedSize = v; }

    std::uint64_t cleanNonSpecSize() const { return _cleanNonSpecSize; }
    void setCleanNonSpecSize(std::uint64_t v) { _cleanNonSpecSize = v; }

    std::uint64_t wiredSize() const { return _wiredSize; }
    void setWiredSize(std::uint64_t v) { _wiredSize = v; }

    std::uint32_t user_tag() const { return _user_tag; }
    void setUser_tag(std::uint32_t tag) { _user_tag = tag; }

    // 0: the range has no object and adds no bytes to any object total.
    std::uint64_t object_id() const { return _object_id; }
    void setObject_id(std::uint64_t id) { _object_id = id; }

    // The kernel's share-mode code; 1 is copy-on-write.
    std::uint8_t share_mode() const { return _share_mode; }
    void setShare_mode(std::uint8_t mode) { _share_mode = mode; }

    bool inSharedCache() const { return _inSharedCache; }
    void setInSharedCache(bool v) { _inSharedCache = v; }

    bool unusedSharedCacheRegion() const { return _unusedSharedCacheRegion; }
    void setUnusedSharedCacheRegion(bool v) { _unusedSharedCacheRegion = v; }

    bool purgeableNonVolatile() const { return _purgeableNonVolatile; }
    void setPurgeableNonVolatile(bool v) { _purgeableNonVolatile = v; }

    // Natural order: ascending start, then the larger size first.
    // Returns -1, 0 or 1.
    std::int64_t compare(const VSMemoryRegion &other) const;

    // Category name of anonymous memory with this user tag; nullopt for
    // tag 0 (the caller names such memory itself). Consults the names
    // registered at run time (vs::registerDynamicTagName) before falling
    // back to "tag %d".
    static std::optional<std::string> categoryNameForTag(std::uint32_t tag);
    // The category of named shared memory at `path` as the kernel shows it:
    // "shared memory /dev/shm/NAME", "shared memory memfd:NAME",
    // "shared memory SYSV0000002a (key 0x0000002a)".
    static std::string sharedMemoryCategoryName(std::string_view path);

private:
    VSMemoryObject *_memoryObject = nullptr;
    std::atomic<const std::string *> _name{nullptr};
    std::atomic<const std::string *> _detailedName{nullptr};
    std::uint64_t _offset = 0;
    std::uint64_t _start = 0;
    std::uint64_t _size = 0;
    std::uint64_t _dirtySize = 0;
    std::uint64_t _reclaimableSize = 0;
    std::uint64_t _swappedSize = 0;
    std::uint64_t _cleanNonSpecSize = 0;
    std::uint64_t _wiredSize = 0;
    std::uint64_t _object_id = 0;
    std::uint32_t _user_tag = 0;
    VSSegmentKind _segment = VSSegmentUnknown;
    std::uint8_t _share_mode = 0;
    // One byte for the three flags keeps a region at 104 bytes, not 112: a
    // run over a process with a million mappings holds a million of them.
    bool _inSharedCache : 1 = false;
    bool _unusedSharedCacheRegion : 1 = false;
    bool _purgeableNonVolatile : 1 = false;
};
static_assert(sizeof(void *) != 8 || sizeof(VSMemoryRegion) <= 104);

namespace vs {

// User tags the Linux layer assigns (slots of the fixed name table).
inline constexpr std::uint32_t kTagSbrk = 5;                // "sbrk"   ([heap])
inline constexpr std::uint32_t kTagStack = 30;              // "stack"
inline constexpr std::uint32_t kTagGuard = 31;              // "guard"  (---p anonymous)
inline constexpr std::uint32_t kTagDynamicLoader = 20;      // "ld.so"
inline constexpr std::uint32_t kTagSharedMemory = 21;       // "shared memory"
inline constexpr std::uint32_t kTagVdso = 33;               // "vdso"
inline constexpr std::uint32_t kTagVvar = 34;               // "vvar"
inline constexpr std::uint32_t kTagVsyscall = 40;           // "vsyscall"
inline constexpr std::uint32_t kTagJitCode = 41;            // "JIT code"
inline constexpr std::uint32_t kTagMallocArena = 42;        // "glibc malloc arena"
inline constexpr std::uint32_t kTagMemfd = 43;              // "memfd"
inline constexpr std::uint32_t kTagSysVSharedMemory = 44;   // "SysV shared memory"
inline constexpr std::uint32_t kTagPosixSharedMemory = 45;  // "POSIX shared memory"
inline constexpr std::uint32_t kTagDevZero = 46;            // "/dev/zero mapping"

// Shared memory that users create by name (tmpfs and /dev/shm files, memfd,
// SysV segments) is shown under that name.
inline bool isNamedSharedMemoryTag(std::uint32_t tag) {
    return tag == kTagSharedMemory || tag == kTagMemfd || tag == kTagSysVSharedMemory || tag == kTagPosixSharedMemory;
}
inline constexpr std::uint32_t kTagHugetlb = 83;            // "hugetlbfs"
inline constexpr std::uint32_t kTagUprobes = 86;            // "uprobes"

// Tags 240 to 255 are numbered "app-specific tag 1" to "16".
inline constexpr std::uint32_t kTagAppSpecificFirst = 240;
// All 32 bits set: "Non-volatile physical vestage".
inline constexpr std::uint32_t kTagNonVolatilePhysVestage = 0xFFFFFFFFu;

// Names registered at run time get tags from here up, far above the fixed
// table so that they never shadow a kernel-reported number.
inline constexpr std::uint32_t kFirstDynamicTag = 0x10000;

// The fixed text of one slot of the 256-slot table; nullptr when empty.
const char *userTagTableName(std::uint32_t tag);

// Returns the tag standing for `name` (e.g. the NAME of "[anon:NAME]"),
// handing out a new one on first use; the same name gets the same tag for
// the rest of the run. Thread-safe.
std::uint32_t registerDynamicTagName(const std::string &name);

// The run-wide copy of `text`: equal texts give the same string, which
// lives until the program ends. Thread-safe.
const std::string *internedString(std::string_view text);

// The name registered for a dynamic tag, or nullopt. Thread-safe.
std::optional<std::string> dynamicTagName(std::uint32_t tag);

} // namespace vs
