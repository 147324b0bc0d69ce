#pragma once

// VSFakePlatform: a scripted stand-in for the platform layer. A test states
// processes, their address spaces and the kernel's records, installs the
// fake, runs the logic and then looks at what was asked:
//
//     VSFakePlatform fake;
//     auto installed = fake.install();
//     auto p = fake.process(42, "worker").parent(1).executable("/usr/bin/worker");
//     p.region(0x10000, 0x4000).tag(1).resident(4).dirtied(2);
//     p.region(0x20000, 0x2000).file("/usr/lib/libz.so").resident(1);
//     auto cache = p.region(0x180000000, 0x100000000);           // a submap:
//     cache.nested(0x180000000, 0x4000).resident(4);             // region_recurse
//     p.pages(0x180000000, {0x9, 0x1, 0x10});                    // descends into it
//     p.exitsAt(VSFakeQuery::RegionRecurse, 3);   // gone from the 3rd walk query on
//     fake.failOnCall(VSFakeQuery::PageRangeQuery, 2, vs::kReturnInvalidArgument);
//
// Scripting is not thread-safe: script first, then run. The queries
// themselves are (one lock), so the parallel gathering can run on the fake.
//
// Answers follow the real layer's rules: a process that exited is gone from
// every pid query (errno 3) and its task answers vs::kReturnDeadPort to the
// region queries and vs::kReturnInvalidArgument to page queries; a zombie
// is still listed, reports run status 5, and its task answers like an exited
// one. A "corpse" process is invisible to pid queries but its memory stays
// readable through handleFor(pid), as a crash snapshot's is.

#include <cstdint>
#include <deque>
#include <iosfwd>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "targets/platform/platform.h"

// Every query the fake answers, for call counts and failure injection.
enum class VSFakeQuery {
    ListAllPids,
    PidBsdInfo,
    PidShortInfo,
    PidDirtyFlags,
    PidResourceUsage,
    PidRegionFilename,
    ArgumentAreaMaxSize,
    ProcessArgumentArea,
    TargetPlatformCode,
    TaskHandleForPid,
    ReleaseTaskHandle,
    RegionRecurse,
    RegionInfo,
    PageRangeQuery,
    PurgeableControl,
    TaskMemoryInfo,
    Symbolicator,
    ReportErrorCode,
    KernelMemoryInfo,
    ReleaseMemory,
    LoadedKextInfo,
    KernelSymbolicator,
    PortsLookup,
    SysctlByNameRead,
    SysctlByNameWrite,
    Count
};

// One recorded query.
struct VSFakeCall {
    VSFakeQuery query = VSFakeQuery::Count;
    int32_t pid = -1;      // the process asked about (through its task), -1 if none
    uint64_t address = 0;  // the address as given
    uint64_t length = 0;   // page_range_query: bytes asked; release_memory: bytes
    uint64_t room = 0;     // page_range_query: words of room
    int32_t result = 0;    // the return code (bytes stored for pid_bsd_info ...)
};

// Script records. Tests normally fill them through the builders below.
struct VSFakeRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    uint32_t depth = 0;   // nesting depth: 0 top level, 1 inside a submap ...
    bool submap = false;  // has nested regions
    VSRegionInfo info;
    std::string path;  // pid_region_filename's answer; empty for none
    std::optional<int32_t> purgeableState;  // none: purgeable_control fails
    uint64_t end() const { return start + size; }
};

enum class VSFakeProcessState { Running, Zombie, Exited };

struct VSFakeStateChange {
    VSFakeQuery query;
    uint64_t call;  // this pid's n-th call of the query (1-based) triggers it
    VSFakeProcessState state;
};

struct VSFakeFailure {
    VSFakeQuery query;
    std::optional<int32_t> pid;  // counted per pid when set, over all calls otherwise
    uint64_t firstCall = 1;      // 1-based, inclusive
    uint64_t lastCall = UINT64_MAX;
    int32_t code = 0;
};

struct VSFakeProcess {
    int32_t pid = 0;
    VSBsdInfo bsdInfo;
    bool listed = true;  // false: a corpse, reachable only through its handle
    VSFakeProcessState state = VSFakeProcessState::Running;
    std::vector<VSFakeStateChange> stateChanges;
    std::optional<std::string> argumentArea;  // none: the query fails with EINVAL
    VSResourceUsageInfo resourceUsage;
    uint32_t dirtyFlags = 0;
    VSTaskKernelMemoryInfo kernelMemory;
    std::optional<uint64_t> platformCode;
    std::map<std::pair<uint64_t, uint32_t>, VSFakeRegion> regions;  // by (start, depth)
    std::map<uint64_t, int32_t> pageDispositions;  // by page address; absent pages read 0
    std::map<uint64_t, int32_t> purgeableByAddress;  // exact-address overrides
    std::vector<VSSymbolicatorImage> images;  // reported in this order
    uint32_t openHandles = 0;
};

struct VSFakeKernelSymbol {
    uint64_t start = 0;
    uint64_t size = 0;
    std::string name;
    std::optional<VSSourceLocation> location;
};

class VSFakePlatform;
class VSFakeProcessBuilder;

class VSFakeRegionBuilder {
public:
    VSFakeRegionBuilder(VSFakePlatform &fake, VSFakeProcess &process, VSFakeRegion &region)
        : _fake(&fake), _process(&process), _region(&region) {}

    VSFakeRegionBuilder &tag(uint32_t userTag);
    VSFakeRegionBuilder &resident(uint32_t pages);
    VSFakeRegionBuilder &dirtied(uint32_t pages);
    VSFakeRegionBuilder &swappedOut(uint32_t pages);
    VSFakeRegionBuilder &reusable(uint32_t pages);
    VSFakeRegionBuilder &sharedNowPrivate(uint32_t pages);
    VSFakeRegionBuilder &wired(uint16_t pages);  // user wired count
    VSFakeRegionBuilder &referenceCount(uint32_t count);
    VSFakeRegionBuilder &shareMode(uint8_t mode);
    VSFakeRegionBuilder &objectId(uint32_t id);
    VSFakeRegionBuilder &offset(uint64_t offset);
    VSFakeRegionBuilder &protection(int32_t current, int32_t maximum);
    VSFakeRegionBuilder &inheritance(uint32_t inheritance);
    VSFakeRegionBuilder &behaviour(int32_t behaviour);
    VSFakeRegionBuilder &external(bool backedByFile = true);
    // A mapped file: sets the path and the external pager flag.
    VSFakeRegionBuilder &file(std::string path);
    // Only the path pid_region_filename answers.
    VSFakeRegionBuilder &path(std::string path);
    VSFakeRegionBuilder &purgeable(int32_t state);
    // Sets the record's submap flag on a plain region (what the walk must
    // never see with unlimited depth).
    VSFakeRegionBuilder &submapFlag(bool set = true);
    // Replaces the whole record.
    VSFakeRegionBuilder &info(const VSRegionInfo &record);
    // Disposition words for the pages from the region's first page on.
    VSFakeRegionBuilder &pages(const std::vector<int32_t> &words);

    // Makes this region a submap and adds a region inside it (absolute
    // addresses, within this region's range).
    VSFakeRegionBuilder nested(uint64_t start, uint64_t size);

    VSRegionInfo &record() { return _region->info; }
    VSFakeRegion &region() { return *_region; }

private:
    VSFakePlatform *_fake;
    VSFakeProcess *_process;
    VSFakeRegion *_region;
};

class VSFakeImageBuilder {
public:
    VSFakeImageBuilder(VSFakeProcess &process, size_t index) : _process(&process), _index(index) {}
    // Segments are reported in the order they are added.
    VSFakeImageBuilder &segment(std::string name, uint64_t start, uint64_t length);

private:
    VSFakeProcess *_process;
    size_t _index;
};

class VSFakeProcessBuilder {
public:
    VSFakeProcessBuilder(VSFakePlatform &fake, VSFakeProcess &process) : _fake(&fake), _process(&process) {}

    int32_t pid() const { return _process->pid; }
    VSTaskHandle handle() const;
    VSFakeProcess &record() { return *_process; }

    // BSD info record.
    VSFakeProcessBuilder &parent(int32_t ppid);
    VSFakeProcessBuilder &name(std::string_view name);  // the 32-byte name field only
    VSFakeProcessBuilder &commandName(std::string_view name);  // the 16-byte field only
    VSFakeProcessBuilder &flags(uint32_t flags);  // replaces all flags
    VSFakeProcessBuilder &is64bit(bool is64bit = true);
    VSFakeProcessBuilder &bsdInfo(const VSBsdInfo &record);

    // Argument area: count, executable path, padding, arguments. Without one
    // the argument-area query fails and the name comes from the record.
    VSFakeProcessBuilder &executable(std::string_view path, const std::vector<std::string> &arguments = {});
    VSFakeProcessBuilder &argumentArea(std::string bytes);

    VSFakeProcessBuilder &resourceUsage(uint64_t physVestage, uint64_t lifetimeMaxPhysVestage);
    VSFakeProcessBuilder &residentSize(uint64_t bytes);
    VSFakeProcessBuilder &dirtyFlags(uint32_t flags);
    VSFakeProcessBuilder &kernelMemory(uint64_t privateAllocated, uint64_t privateFreed, uint64_t sharedAllocated,
                                       uint64_t sharedFreed);
    VSFakeProcessBuilder &platformCode(uint64_t code);
    VSFakeProcessBuilder &refuseTaskHandle(VSReturnCode code);

    // Life cycle.
    VSFakeProcessBuilder &zombie();
    VSFakeProcessBuilder &exited();
    VSFakeProcessBuilder &corpse();  // not listed; memory readable through handle()
    // The state changes just before this pid's n-th call of the query is
    // answered, so that call already sees the new state.
    VSFakeProcessBuilder &exitsAt(VSFakeQuery query, uint64_t call);
    VSFakeProcessBuilder &becomesZombieAt(VSFakeQuery query, uint64_t call);

    // Failures counted over this pid's calls of the query. The code is what
    // the query returns (the errno for pid_short_info and the argument
    // queries, the byte count for pid_bsd_info); queries without a code
    // (symbolicator) answer empty.
    VSFakeProcessBuilder &failOnCall(VSFakeQuery query, uint64_t call, int32_t code);
    VSFakeProcessBuilder &failFromCall(VSFakeQuery query, uint64_t call, int32_t code);
    VSFakeProcessBuilder &failAlways(VSFakeQuery query, int32_t code);

    // Address space.
    VSFakeRegionBuilder region(uint64_t start, uint64_t size);
    VSFakeProcessBuilder &pages(uint64_t address, const std::vector<int32_t> &words);
    VSFakeProcessBuilder &purgeableAt(uint64_t address, int32_t state);
    VSFakeImageBuilder image(std::string path);

private:
    VSFakePlatform *_fake;
    VSFakeProcess *_process;
};

class VSFakeSiteBuilder {
public:
    VSFakeSiteBuilder(std::deque<VSKernelSiteInfo> &sites, size_t index) : _sites(&sites), _index(index) {}
    VSFakeSiteBuilder &mapped(uint64_t bytes);
    VSFakeSiteBuilder &zone(uint16_t index);  // also sets the zone-share flag
    VSFakeSiteBuilder &name(std::string_view name);  // also sets the own-name flag
    VSKernelSiteInfo &record() { return (*_sites)[_index]; }

private:
    std::deque<VSKernelSiteInfo> *_sites;
    size_t _index;
};

class VSFakeKernelBuilder {
public:
    explicit VSFakeKernelBuilder(VSFakePlatform &fake) : _fake(&fake) {}
    // The name is stored as given (cut at 80 bytes, not necessarily terminated).
    VSFakeKernelBuilder &zone(std::string_view name, uint64_t elementsInUse, uint64_t currentSize,
                              uint64_t elementSize, bool collectable = false);
    VSFakeKernelBuilder &zone(std::string_view name, const VSKernelZoneInfo &info);
    VSFakeSiteBuilder site(uint64_t flags, uint64_t site, uint64_t size);
    VSFakeKernelBuilder &kext(std::string bundleIdentifier, uint64_t loadTag);
    VSFakeKernelBuilder &kextWithoutBundleIdentifier(std::string key, uint64_t loadTag);
    VSFakeKernelBuilder &symbol(uint64_t start, uint64_t size, std::string name);
    VSFakeKernelBuilder &sourceLocation(uint64_t start, std::optional<std::string> path, uint32_t line);

private:
    VSFakePlatform *_fake;
};

class VSFakePlatform : public VSPlatform {
public:
    VSFakePlatform();
    ~VSFakePlatform() override;

    // Installs this fake as the current platform until the guard dies, then
    // puts back what was installed before.
    class Installation {
    public:
        explicit Installation(VSPlatform *previous) : _previous(previous) {}
        Installation(const Installation &) = delete;
        Installation &operator=(const Installation &) = delete;
        ~Installation() { VSPlatform::setCurrent(_previous); }

    private:
        VSPlatform *_previous;
    };
    [[nodiscard]] std::unique_ptr<Installation> install();

    // The task handle of a pid: what task_handle_for_pid hands out and what
    // a corpse port carries.
    static VSTaskHandle handleFor(int32_t pid) { return 0x10000u + static_cast<uint32_t>(pid); }

    // ---- scripting ----------------------------------------------------------------
    // Creates the process (listed in creation order) or returns the existing
    // one. A new process is 64-bit, running, with parent 1, and `name` in
    // both name fields (as far as each holds).
    VSFakeProcessBuilder process(int32_t pid, std::string_view name = {});
    // The kernel's record: pid 0, system flag, parent 0, named "kernel".
    VSFakeProcessBuilder kernelProcess();
    VSFakeKernelBuilder kernel() { return VSFakeKernelBuilder(*this); }

    VSFakePlatform &pageSize(uint64_t bytes);
    VSFakePlatform &ownPid(int32_t pid);
    VSFakePlatform &effectiveUserId(uint32_t uid);
    VSFakePlatform &argumentMax(int32_t bytes);
    VSFakePlatform &platformCodeForAll(uint64_t code);  // e.g. VSPlatformNone
    VSFakePlatform &tagName(uint32_t tag, std::string name);
    VSFakePlatform &errorText(VSReturnCode code, std::string text);
    VSFakePlatform &setting(std::string name, int32_t value);
    VSFakePlatform &ports(std::vector<uint32_t> ports);
    VSFakePlatform &corpsePort(int32_t pid);  // ports = { handleFor(pid) }
    // Where report_error_code writes; null for nowhere. Default std::cerr.
    VSFakePlatform &errorStream(std::ostream *stream);

    // Failures counted over all calls of the query (see the process builder
    // for what the code means).
    VSFakePlatform &failOnCall(VSFakeQuery query, uint64_t call, int32_t code);
    VSFakePlatform &failFromCall(VSFakeQuery query, uint64_t call, int32_t code);
    VSFakePlatform &failAlways(VSFakeQuery query, int32_t code);
    VSFakePlatform &addFailure(const VSFakeFailure &failure);

    // ---- what was asked ------------------------------------------------------------
    uint64_t callCount(VSFakeQuery query) const;
    uint64_t callCount(VSFakeQuery query, int32_t pid) const;
    std::vector<VSFakeCall> calls(VSFakeQuery query) const;
    std::vector<VSFakeCall> allCalls() const;
    std::vector<std::pair<std::string, VSReturnCode>> reportedErrors() const;
    std::vector<std::pair<std::string, int32_t>> settingWrites() const;
    std::optional<int32_t> settingValue(const std::string &name) const;
    uint32_t openTaskHandles() const;    // acquired and not yet released
    size_t outstandingKernelArrays() const;  // handed out by kernel_memory_info, not released
    void clearCalls();

    // ---- VSPlatform ---------------------------------------------------------------
    int32_t list_all_pids(std::span<int32_t> buffer) override;
    int32_t pid_bsd_info(int32_t pid, VSBsdInfo &info) override;
    int32_t pid_short_info(int32_t pid, VSShortInfo &info, int32_t &errorNumber) override;
    int32_t pid_dirty_flags(int32_t pid, uint32_t &flags) override;
    int32_t pid_resource_usage(int32_t pid, int32_t version, VSResourceUsageInfo &info) override;
    int32_t pid_region_filename(int32_t pid, uint64_t address, std::span<char> buffer) override;
    int32_t argument_area_max_size(int32_t &size) override;
    int32_t process_argument_area(int32_t pid, std::span<char> buffer, size_t &length) override;
    uint64_t target_platform_code(int32_t pid, bool is64bit) override;
    VSReturnCode task_handle_for_pid(int32_t pid, VSTaskHandle &task) override;
    VSReturnCode release_task_handle(VSTaskHandle task) override;
    VSReturnCode region_recurse(VSTaskHandle task, uint64_t &address, uint64_t &size, uint32_t &depth,
                                VSRegionInfo &info, uint32_t &infoCount) override;
    VSReturnCode region_info(VSTaskHandle task, uint64_t &address, uint64_t &size, int32_t flavor,
                             VSRegionBasicInfo &info, uint32_t &infoCount, uint32_t &objectName) override;
    VSReturnCode page_range_query(VSTaskHandle task, uint64_t address, uint64_t length,
                                  std::span<int32_t> dispositions, uint64_t &count) override;
    VSReturnCode purgeable_control(VSTaskHandle task, uint64_t address, int32_t operation, int32_t &state) override;
    VSReturnCode task_memory_info(VSTaskHandle task, VSTaskKernelMemoryInfo &info, uint32_t &count) override;
    std::vector<VSSymbolicatorImage> symbolicator(VSTaskHandle task, uint32_t flags) override;
    uint64_t kernel_page_size() override;
    std::string error_text(VSReturnCode code) override;
    void report_error_code(std::string_view label, VSReturnCode code) override;
    std::optional<std::string> dynamic_tag_name(uint32_t tag) override;
    VSReturnCode kernel_memory_info(std::span<const VSKernelZoneName> &zoneNames,
                                    std::span<const VSKernelZoneInfo> &zoneInfos,
                                    std::span<const VSKernelSiteInfo> &siteInfos) override;
    VSReturnCode release_memory(const void *address, uint64_t length) override;
    std::map<std::string, VSKextInfo> loaded_kext_info() override;
    std::unique_ptr<VSKernelSymbolicator> kernel_symbolicator() override;
    VSReturnCode ports_lookup(std::vector<uint32_t> &ports) override;
    int32_t sysctl_by_name_read(std::string_view name, int32_t &value) override;
    int32_t sysctl_by_name_write(std::string_view name, int32_t value) override;
    int32_t own_pid() override;
    uint32_t effective_user_id() override;

private:
    friend class VSFakeRegionBuilder;
    friend class VSFakeProcessBuilder;
    friend class VSFakeKernelBuilder;

    struct KernelArray;

    // Counts the call, applies scripted state changes and returns the
    // injected failure code, if any. Called with the lock held.
    std::optional<int32_t> _enter(VSFakeQuery query, VSFakeProcess *process);
    int32_t _log(VSFakeCall call);  // returns call.result
    VSFakeProcess *_processForPid(int32_t pid);
    VSFakeProcess *_processForTask(VSTaskHandle task);
    static bool _isAlive(const VSFakeProcess *process);       // running and listed
    static bool _memoryReadable(const VSFakeProcess *process);  // running (also a corpse)
    const VSFakeRegion *_regionContaining(const VSFakeProcess &process, uint64_t address) const;
    const VSFakeRegion *_findRecursive(const VSFakeProcess &process, uint32_t level, uint64_t low, uint64_t high,
                                       uint64_t address, uint32_t maxDepth) const;

    mutable std::mutex _mutex;
    std::map<int32_t, VSFakeProcess> _processes;
    std::vector<int32_t> _listOrder;
    uint32_t _nextObjectId = 0x100;

    uint64_t _pageSize = 4096;
    int32_t _ownPid = 99999;
    uint32_t _effectiveUserId = 0;
    int32_t _argumentMax = 0x40000;
    std::optional<uint64_t> _platformCodeForAll;
    std::map<uint32_t, std::string> _tagNames;
    std::map<VSReturnCode, std::string> _errorTexts;
    std::map<std::string, int32_t, std::less<>> _settings;
    std::vector<std::pair<std::string, int32_t>> _settingWrites;
    std::vector<uint32_t> _ports;
    std::ostream *_errorStream;

    std::vector<VSFakeFailure> _failures;
    std::vector<VSFakeCall> _calls;
    std::map<VSFakeQuery, uint64_t> _callCounts;
    std::map<std::pair<int32_t, VSFakeQuery>, uint64_t> _pidCallCounts;
    std::vector<std::pair<std::string, VSReturnCode>> _reportedErrors;

    std::vector<VSKernelZoneName> _zoneNames;
    std::vector<VSKernelZoneInfo> _zoneInfos;
    std::deque<VSKernelSiteInfo> _sites;
    std::map<std::string, VSKextInfo> _kexts;
    std::vector<VSFakeKernelSymbol> _kernelSymbols;
    std::map<const void *, std::unique_ptr<KernelArray>> _kernelArrays;
};
