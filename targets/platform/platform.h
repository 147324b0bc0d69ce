#pragma once

// The one door to the operating system. Everything the program learns about
// processes, their address spaces and the kernel goes through VSPlatform:
// the Linux layer answers from procfs, the test double from a script. The
// layer passes records and codes through unchanged and decides nothing; the
// logic above it reads the records at the byte offsets fixed below, so the
// layouts are checked at compile time.
//
// Conventions shared by all queries:
// - Return codes are signed 32-bit: 0 success, anything else a failure whose
//   text error_text() gives. Four codes mean something to the logic (see
//   vs::kReturn*).
// - In/out parameters follow the calls' original shape: an address goes in
//   and comes back as the start of the region found; record lengths are
//   counted in 32-bit words and come back as the words filled.
// - Every query may be called from several gathering threads at once for
//   different targets; implementations are thread-safe.

#include <array>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

using VSTaskHandle = uint32_t;  // 0 is "no handle"
using VSReturnCode = int32_t;

namespace vs {

// ---- return codes ----------------------------------------------------------
inline constexpr VSReturnCode kReturnSuccess = 0;
// No region at or above the address: the normal end of a region walk.
inline constexpr VSReturnCode kReturnNoMoreRegions = 1;
// What page_range_query answers once the process has gone away.
inline constexpr VSReturnCode kReturnInvalidArgument = 4;
// What the region queries answer once the task has gone away.
inline constexpr VSReturnCode kReturnDeadPort = 0x10000003;

// System error number of a pid query for a process that does not exist.
inline constexpr int32_t kErrorNoSuchProcess = 3;

inline constexpr VSTaskHandle kTaskHandleNone = 0;
// Port names with a fixed meaning in ports_lookup's answer.
inline constexpr uint32_t kPortNull = 0;
inline constexpr uint32_t kPortDead = 0xFFFFFFFF;

// ---- BSD info record flags ---------------------------------------------------
inline constexpr uint32_t kBsdInfoFlagSystem = 0x1;  // the kernel's record
inline constexpr uint32_t kBsdInfoFlag64Bit = 0x10;

// Short record run status of a zombie.
inline constexpr uint32_t kRunStatusZombie = 5;

// ---- dirty-tracking flags (pid_dirty_flags) --------------------------------
inline constexpr uint32_t kDirtyFlagTracked = 0x1;
inline constexpr uint32_t kDirtyFlagAllowIdleExit = 0x2;
inline constexpr uint32_t kDirtyFlagIsDirty = 0x4;

inline constexpr int32_t kResourceUsageVersion4 = 4;

// ---- region queries ----------------------------------------------------------
inline constexpr uint32_t kRegionInfoCount = 17;  // VSRegionInfo in 32-bit words
inline constexpr int32_t kRegionBasicInfoFlavor = 9;
inline constexpr uint32_t kRegionBasicInfoCount = 9;  // VSRegionBasicInfo in words
inline constexpr uint32_t kTaskKernelMemoryInfoCount = 8;
// region_recurse depth meaning "descend through every submap".
inline constexpr uint32_t kUnlimitedDepth = 0xFFFFFFFF;
// pid_region_filename buffer size the walk uses.
inline constexpr size_t kRegionFilenameBufferSize = 1024;

// Share-mode codes. The logic treats only copy-on-write specially and passes
// the others on; the Linux layer produces the first four.
inline constexpr uint8_t kShareModeCopyOnWrite = 1;
inline constexpr uint8_t kShareModePrivate = 2;
inline constexpr uint8_t kShareModeEmpty = 3;
inline constexpr uint8_t kShareModeShared = 4;

// Inheritance codes (copied only).
inline constexpr uint32_t kInheritShare = 0;
inline constexpr uint32_t kInheritCopy = 1;
inline constexpr uint32_t kInheritNone = 2;

// Protection bits (copied only).
inline constexpr int32_t kProtRead = 0x1;
inline constexpr int32_t kProtWrite = 0x2;
inline constexpr int32_t kProtExecute = 0x4;

// ---- page disposition word bits (page_range_query) -------------------------
inline constexpr int32_t kPageDispositionPresent = 0x1;
inline constexpr int32_t kPageDispositionDirty = 0x8;
inline constexpr int32_t kPageDispositionPagedOut = 0x10;  // compressed or swapped
inline constexpr int32_t kPageDispositionExternal = 0x80;  // file-backed object

// purgeable_control operation that reads the state.
inline constexpr int32_t kPurgeableGetState = 1;

// ---- kernel wired-memory site flags ------------------------------------------
inline constexpr uint64_t kSiteTypeMask = 0xFF;
inline constexpr uint64_t kSiteTypeTag = 0;
inline constexpr uint64_t kSiteTypeKext = 1;
inline constexpr uint64_t kSiteTypeCodeAddress = 2;
inline constexpr uint64_t kSiteTypeCounter = 3;
inline constexpr uint64_t kSiteFlagWired = 0x100;
inline constexpr uint64_t kSiteFlagHidden = 0x200;
inline constexpr uint64_t kSiteFlagNamed = 0x400;
inline constexpr uint64_t kSiteFlagZoneShare = 0x800;

// Symbolicator flags: list images and segments only, load no symbols and no
// source-line information.
inline constexpr uint32_t kSymbolicatorNoSymbols = 0x1;
inline constexpr uint32_t kSymbolicatorNoSourceInfo = 0x2;
inline constexpr uint32_t kSymbolicatorImagesOnly = kSymbolicatorNoSymbols | kSymbolicatorNoSourceInfo;

}  // namespace vs

// Purgeable states reported by purgeable_control. The walk also uses
// VSPurgeableDeny when the query fails.
enum VSPurgeableState : int32_t {
    VSPurgeableNonVolatile = 0,
    VSPurgeableVolatile = 1,
    VSPurgeableEmpty = 2,
    VSPurgeableDeny = 3,
};

// Platform codes locating a target's shared cache region. Code 5 is what a
// heapfile description that names no known architecture yields; Linux has
// no shared cache region at all and answers VSPlatformNone (base 0, size 0).
enum VSPlatformCode : uint64_t {
    VSPlatformX86 = 0,
    VSPlatformX86_64 = 1,
    VSPlatformARM = 2,
    VSPlatformARM64 = 3,
    VSPlatformARM64_32 = 4,
    VSPlatformUnknown = 5,
    VSPlatformNone = 6,
};

// ---- records -------------------------------------------------------------------
// Only the named fields are read; the reserved bytes keep the layout. Text
// fields are zero-padded and need not be terminated.

struct VSBsdInfo {
    uint32_t flags = 0;  // vs::kBsdInfoFlag*
    uint32_t _reserved0[2] = {};
    uint32_t pid = 0;
    uint32_t ppid = 0;
    uint32_t _reserved1[7] = {};
    char commandName[16] = {};
    char name[32] = {};
    uint8_t _reserved2[40] = {};
};
static_assert(sizeof(VSBsdInfo) == 136);
static_assert(offsetof(VSBsdInfo, flags) == 0);
static_assert(offsetof(VSBsdInfo, pid) == 12);
static_assert(offsetof(VSBsdInfo, ppid) == 16);
static_assert(offsetof(VSBsdInfo, commandName) == 48);
static_assert(offsetof(VSBsdInfo, name) == 64);

struct VSShortInfo {
    uint32_t _reserved0[3] = {};
    uint32_t runStatus = 0;  // vs::kRunStatusZombie for a zombie
    uint8_t _reserved1[48] = {};
};
static_assert(sizeof(VSShortInfo) == 64);
static_assert(offsetof(VSShortInfo, runStatus) == 12);

// Resource usage, record version 4.
struct VSResourceUsageInfo {
    uint8_t _reserved0[64] = {};
    uint64_t residentSize = 0;  // bytes resident, of any kind; 0: unknown
    uint64_t physVestage = 0;  // bytes
    uint8_t _reserved1[160] = {};
    uint64_t lifetimeMaxPhysVestage = 0;  // bytes
    uint8_t _reserved2[48] = {};
};
static_assert(offsetof(VSResourceUsageInfo, physVestage) == 72);
static_assert(offsetof(VSResourceUsageInfo, lifetimeMaxPhysVestage) == 240);
static_assert(sizeof(VSResourceUsageInfo) == 296);

// Kernel memory charged to a task (task_memory_info), 8 words.
struct VSTaskKernelMemoryInfo {
    uint64_t privateAllocated = 0;
    uint64_t privateFreed = 0;
    uint64_t sharedAllocated = 0;
    uint64_t sharedFreed = 0;
};
static_assert(sizeof(VSTaskKernelMemoryInfo) == 4 * vs::kTaskKernelMemoryInfoCount);
static_assert(offsetof(VSTaskKernelMemoryInfo, privateFreed) == 8);
static_assert(offsetof(VSTaskKernelMemoryInfo, sharedAllocated) == 16);
static_assert(offsetof(VSTaskKernelMemoryInfo, sharedFreed) == 24);

// The walk's per-region record (region_recurse). Fields are aligned to 4
// bytes so that the 64-bit offset sits at byte 12. Page counts are in
// target pages.
#pragma pack(push, 4)
struct VSRegionInfo {
    int32_t protection = 0;
    int32_t maxProtection = 0;
    uint32_t inheritance = 0;
    uint64_t offset = 0;  // of the range in its memory object
    uint32_t userTag = 0;
    uint32_t residentPages = 0;
    uint32_t sharedNowPrivatePages = 0;
    uint32_t swappedOutPages = 0;
    uint32_t dirtiedPages = 0;
    uint32_t referenceCount = 0;
    uint16_t shadowDepth = 0;
    uint8_t externalPager = 0;  // 1: backed by a file
    uint8_t shareMode = 0;      // vs::kShareMode*
    int32_t isSubmap = 0;       // 32-bit boolean
    int32_t behaviour = 0;
    uint32_t objectId = 0;
    uint16_t userWiredCount = 0;  // pages
    uint16_t _padding = 0;
    uint32_t reusablePages = 0;
};

// Top-level region record (region_info, flavour 9).
struct VSRegionBasicInfo {
    int32_t protection = 0;
    int32_t maxProtection = 0;
    uint32_t inheritance = 0;
    uint32_t shared = 0;  // 32-bit boolean
    uint32_t reserved = 0;
    uint64_t offset = 0;
    int32_t behaviour = 0;
    uint16_t userWiredCount = 0;
    uint16_t _padding = 0;
};
#pragma pack(pop)
static_assert(sizeof(VSRegionInfo) == 68 && sizeof(VSRegionInfo) == 4 * vs::kRegionInfoCount);
static_assert(offsetof(VSRegionInfo, protection) == 0);
static_assert(offsetof(VSRegionInfo, maxProtection) == 4);
static_assert(offsetof(VSRegionInfo, inheritance) == 8);
static_assert(offsetof(VSRegionInfo, offset) == 12);
static_assert(offsetof(VSRegionInfo, userTag) == 20);
static_assert(offsetof(VSRegionInfo, residentPages) == 24);
static_assert(offsetof(VSRegionInfo, sharedNowPrivatePages) == 28);
static_assert(offsetof(VSRegionInfo, swappedOutPages) == 32);
static_assert(offsetof(VSRegionInfo, dirtiedPages) == 36);
static_assert(offsetof(VSRegionInfo, referenceCount) == 40);
static_assert(offsetof(VSRegionInfo, shadowDepth) == 44);
static_assert(offsetof(VSRegionInfo, externalPager) == 46);
static_assert(offsetof(VSRegionInfo, shareMode) == 47);
static_assert(offsetof(VSRegionInfo, isSubmap) == 48);
static_assert(offsetof(VSRegionInfo, behaviour) == 52);
static_assert(offsetof(VSRegionInfo, objectId) == 56);
static_assert(offsetof(VSRegionInfo, userWiredCount) == 60);
static_assert(offsetof(VSRegionInfo, reusablePages) == 64);
static_assert(sizeof(VSRegionBasicInfo) == 36 && sizeof(VSRegionBasicInfo) == 4 * vs::kRegionBasicInfoCount);
static_assert(offsetof(VSRegionBasicInfo, shared) == 12);
static_assert(offsetof(VSRegionBasicInfo, reserved) == 16);
static_assert(offsetof(VSRegionBasicInfo, offset) == 20);
static_assert(offsetof(VSRegionBasicInfo, behaviour) == 28);
static_assert(offsetof(VSRegionBasicInfo, userWiredCount) == 32);

// Kernel zone name: 80 bytes, zero-padded, not necessarily terminated.
struct VSKernelZoneName {
    char name[80] = {};
};
static_assert(sizeof(VSKernelZoneName) == 80);

struct VSKernelZoneInfo {
    uint64_t elementsInUse = 0;
    uint64_t currentSize = 0;  // bytes
    uint64_t maxSize = 0;
    uint64_t elementSize = 0;  // bytes
    uint64_t allocationSize = 0;
    uint64_t totalAllocated = 0;
    uint64_t exhaustible = 0;
    uint64_t collectable = 0;  // non-zero: free elements can be given back
};
static_assert(sizeof(VSKernelZoneInfo) == 64);
static_assert(offsetof(VSKernelZoneInfo, currentSize) == 8);
static_assert(offsetof(VSKernelZoneInfo, elementSize) == 24);
static_assert(offsetof(VSKernelZoneInfo, collectable) == 56);

// One wired-memory site entry; `site` means a tag, a kernel-extension load
// tag, a code address or a counter index depending on the type in `flags`.
struct VSKernelSiteInfo {
    uint64_t flags = 0;  // vs::kSiteType* in the low byte, vs::kSiteFlag*
    uint64_t site = 0;
    uint64_t size = 0;  // bytes
    uint64_t freeBytes = 0;
    uint64_t largestFree = 0;
    uint64_t collectable = 0;
    uint64_t mapped = 0;  // the value of counter entries
    uint64_t peak = 0;
    uint16_t tag = 0;
    uint16_t zone = 0;  // index into the zone names when kSiteFlagZoneShare is set
    uint32_t _reserved0 = 0;
    uint64_t _reserved1[3] = {};
    char name[80] = {};  // terminated within the field when present
};
static_assert(sizeof(VSKernelSiteInfo) == 176);
static_assert(offsetof(VSKernelSiteInfo, site) == 8);
static_assert(offsetof(VSKernelSiteInfo, size) == 16);
static_assert(offsetof(VSKernelSiteInfo, mapped) == 48);
static_assert(offsetof(VSKernelSiteInfo, tag) == 64);
static_assert(offsetof(VSKernelSiteInfo, zone) == 66);
static_assert(offsetof(VSKernelSiteInfo, name) == 96);

// One loaded kernel extension (module). Every info carries a load tag; the
// bundle identifier may be missing.
struct VSKextInfo {
    uint64_t loadTag = 0;
    std::optional<std::string> bundleIdentifier;
    uint64_t loadAddress = 0;  // informational
    uint64_t size = 0;         // informational
};

// ---- task symbolicator result ------------------------------------------------
struct VSSymbolicatorSegment {
    // The executable format's own name, possibly followed by a blank and
    // further text, or VSPlatform::image_header_segment_name for the header.
    std::string name;
    uint64_t start = 0;
    uint64_t length = 0;
};

struct VSSymbolicatorImage {
    std::string path;  // as reported; the logic resolves links
    std::vector<VSSymbolicatorSegment> segments;
};

// ---- kernel symbolicator -------------------------------------------------------
struct VSSourceLocation {
    std::optional<std::string> path;  // a location may come without a path
    uint32_t line = 0;
};

// Names kernel code addresses. Destroying it is the release.
class VSKernelSymbolicator {
public:
    virtual ~VSKernelSymbolicator() = default;
    // The name of the symbol containing the address, or nullopt.
    virtual std::optional<std::string> symbol_name_at(uint64_t address) const = 0;
    // The source location of the address, or nullopt.
    virtual std::optional<VSSourceLocation> source_location_at(uint64_t address) const = 0;
};

// ---- the query layer -------------------------------------------------------------
class VSPlatform {
public:
    // Pseudo-segment name under which the symbolicator reports an image's
    // header; the logic names such a segment "__TEXT".
    static constexpr std::string_view image_header_segment_name = "<image header>";

    virtual ~VSPlatform() = default;

    // The installed platform. Installing is done once at start (the program
    // installs the Linux layer, tests the double); current() aborts when
    // nothing is installed. setCurrent(nullptr) uninstalls.
    static VSPlatform &current();
    static void setCurrent(VSPlatform *platform);
    // The installed platform or null, for code that restores a previous one.
    static VSPlatform *installed();

    // Runs the callback exactly once per flag, also under concurrent first use.
    template <class Callback>
    static void run_once(std::once_flag &flag, Callback &&callback) {
        std::call_once(flag, std::forward<Callback>(callback));
    }

    // ---- processes -----------------------------------------------------------------
    // With an empty span: the number of pids in the system. Otherwise stores
    // at most buffer.size() pids in the platform's order and returns how
    // many it stored. Negative on failure.
    virtual int32_t list_all_pids(std::span<int32_t> buffer) = 0;

    // Bytes stored into `info`; only sizeof(VSBsdInfo) (136) is success.
    virtual int32_t pid_bsd_info(int32_t pid, VSBsdInfo &info) = 0;

    // Bytes stored (sizeof(VSShortInfo) on success). On failure returns 0 and
    // sets `errorNumber` (vs::kErrorNoSuchProcess when the process is gone).
    virtual int32_t pid_short_info(int32_t pid, VSShortInfo &info, int32_t &errorNumber) = 0;

    // Stores the dirty-tracking flags (vs::kDirtyFlag*); returns a status the
    // logic ignores. On failure `flags` is left untouched.
    virtual int32_t pid_dirty_flags(int32_t pid, uint32_t &flags) = 0;

    // 0 on success. `version` is vs::kResourceUsageVersion4.
    virtual int32_t pid_resource_usage(int32_t pid, int32_t version, VSResourceUsageInfo &info) = 0;

    // Copies the path of the file mapped at the address into the buffer,
    // without terminator; returns its length, 0 when there is none.
    virtual int32_t pid_region_filename(int32_t pid, uint64_t address, std::span<char> buffer) = 0;

    // Size of a process argument area (name {1, 8}). 0 on success, else a
    // system error number.
    virtual int32_t argument_area_max_size(int32_t &size) = 0;

    // The process's argument area (name {1, 49, pid}): a 32-bit argument
    // count, the executable path, zero padding, then the arguments. Stores
    // at most buffer.size() bytes and their number in `length`. 0 on
    // success, else a system error number.
    virtual int32_t process_argument_area(int32_t pid, std::span<char> buffer, size_t &length) = 0;

    // Platform code of a target (VSPlatformCode); the 64-bit flag is the
    // target's pointer width.
    virtual uint64_t target_platform_code(int32_t pid, bool is64bit) = 0;

    // ---- tasks ----------------------------------------------------------------------
    // Opens the task of a process for reading its memory. Return code; on
    // success `task` names the handle until release_task_handle.
    virtual VSReturnCode task_handle_for_pid(int32_t pid, VSTaskHandle &task) = 0;
    virtual VSReturnCode release_task_handle(VSTaskHandle task) = 0;

    // The region containing `address` or else the first one above it,
    // descending into submaps while the nesting depth is below `depth`
    // (vs::kUnlimitedDepth: always). On success `address` and `size` are
    // that region's start and length, `depth` its nesting depth and `info`
    // its record; `infoCount` goes in as the room in words
    // (vs::kRegionInfoCount) and comes back as the words filled.
    // vs::kReturnNoMoreRegions past the last region; vs::kReturnDeadPort
    // when the task has gone.
    virtual VSReturnCode region_recurse(VSTaskHandle task, uint64_t &address, uint64_t &size, uint32_t &depth,
                                        VSRegionInfo &info, uint32_t &infoCount) = 0;

    // The top-level region containing `address` or the next one above,
    // never descending into submaps. `flavor` is vs::kRegionBasicInfoFlavor,
    // `infoCount` vs::kRegionBasicInfoCount in and out. `objectName` is set
    // but not read.
    virtual VSReturnCode region_info(VSTaskHandle task, uint64_t &address, uint64_t &size, int32_t flavor,
                                     VSRegionBasicInfo &info, uint32_t &infoCount, uint32_t &objectName) = 0;

    // Where one mapping holds pages of several memory objects (the page
    // cache of a private file mapping beside its copies; anonymous pages
    // shared after fork beside its own), the records of every part of the
    // region starting at `address`, the first being the one region_recurse
    // gave. Platforms with one object per region leave `parts` empty.
    virtual VSReturnCode region_parts(VSTaskHandle, uint64_t, std::vector<VSRegionInfo> &parts) {
        parts.clear();
        return 0;
    }

    // Which pages several targets share is known only once every target's
    // pages have been looked at. A run first prepares each target's walk
    // (true: its walk needs the run's resolution; may be called from
    // several threads), then resolves once, then walks. False from
    // resolve_shared_pages when sharing could not be resolved (no right to
    // read page frames); the walk then counts such pages as each target's
    // own.
    virtual bool prepare_task_walk(VSTaskHandle) { return false; }
    virtual bool resolve_shared_pages() { return true; }

    // Disposition words (vs::kPageDisposition*) of the pages from `address`
    // rounded down to the page size up to address + length rounded up, at
    // most dispositions.size() of them; `count` comes back as the number
    // stored. vs::kReturnInvalidArgument once the process has gone.
    virtual VSReturnCode page_range_query(VSTaskHandle task, uint64_t address, uint64_t length,
                                          std::span<int32_t> dispositions, uint64_t &count) = 0;

    // With vs::kPurgeableGetState: the purgeable state (VSPurgeableState) of
    // the object at the address. A failure means "not purgeable".
    virtual VSReturnCode purgeable_control(VSTaskHandle task, uint64_t address, int32_t operation,
                                           int32_t &state) = 0;

    // Kernel memory charged to the task; `count` is
    // vs::kTaskKernelMemoryInfoCount in and out.
    virtual VSReturnCode task_memory_info(VSTaskHandle task, VSTaskKernelMemoryInfo &info, uint32_t &count) = 0;

    // The images loaded in the task at this moment with their segments, in
    // no particular order. Empty when nothing can be listed. `flags` is
    // vs::kSymbolicatorImagesOnly.
    virtual std::vector<VSSymbolicatorImage> symbolicator(VSTaskHandle task, uint32_t flags) = 0;

    // ---- codes and system facts ------------------------------------------------------
    virtual uint64_t kernel_page_size() = 0;

    // The text of a return code (never empty).
    virtual std::string error_text(VSReturnCode code) = 0;

    // Writes the label and the code's text to standard error in the
    // platform's wording. The layer's only output.
    virtual void report_error_code(std::string_view label, VSReturnCode code) = 0;

    // Name of a user tag the platform assigned at run time (named anonymous
    // memory) or of a platform slot of the tag table; nullopt for tags it
    // does not know.
    virtual std::optional<std::string> dynamic_tag_name(uint32_t tag) = 0;

    // ---- kernel target -----------------------------------------------------------
    // On success the three arrays are platform-allocated; each must be
    // given back with release_memory(data, count x record size).
    virtual VSReturnCode kernel_memory_info(std::span<const VSKernelZoneName> &zoneNames,
                                            std::span<const VSKernelZoneInfo> &zoneInfos,
                                            std::span<const VSKernelSiteInfo> &siteInfos) = 0;
    // Releases an array handed out by kernel_memory_info; `length` in bytes.
    virtual VSReturnCode release_memory(const void *address, uint64_t length) = 0;

    // All loaded kernel extensions, keyed by bundle identifier.
    virtual std::map<std::string, VSKextInfo> loaded_kext_info() = 0;

    // A symbolicator for the running kernel, or null when none can be made.
    virtual std::unique_ptr<VSKernelSymbolicator> kernel_symbolicator() = 0;

    // ---- this program's own task ------------------------------------------------------
    // The special ports of this task (a crash snapshot's task handle comes
    // first when the program was launched for one). Ports are task handles
    // the region queries accept. 0 on success.
    virtual VSReturnCode ports_lookup(std::vector<uint32_t> &ports) = 0;

    // A 32-bit integer kernel setting by name. 0 on success, else a system
    // error number (ENOENT, 2, when the setting does not exist).
    virtual int32_t sysctl_by_name_read(std::string_view name, int32_t &value) = 0;
    virtual int32_t sysctl_by_name_write(std::string_view name, int32_t value) = 0;

    virtual int32_t own_pid() = 0;
    virtual uint32_t effective_user_id() = 0;
};
