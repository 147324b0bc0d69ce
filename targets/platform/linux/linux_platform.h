#pragma once

// The query layer on Linux, answered from procfs and sysfs.
//
// A task handle is a small integer naming an entry of a table; the entry
// holds an open /proc/PID directory fd and every later read goes through
// openat() on it. Once the process is reaped those opens fail with ESRCH,
// so a handle never reads a process that reused the pid. Past a budget of
// fds drawn from RLIMIT_NOFILE the entry holds none: each query opens the
// directory again and compares the process's start time with the one seen
// when the handle was made, so any fd limit serves any number of targets.
//
// The region queries answer from one parse of /proc/PID/smaps per handle,
// made on first use and kept on the handle until a walk has passed the last
// region: the images (symbolicator) and the walk (region_recurse,
// region_info) then see the same address space.
// Linux has no submaps and no shared cache region.
//
// Codes: 0 success; 1 past the last region; 4 for page queries of a
// process that has gone; 0x10000003 when a region query finds the process
// gone (reaped, or a zombie whose smaps reads empty); otherwise the errno.

#include "targets/platform/linux/shared_pages.h"
#include "targets/platform/platform.h"

#include <atomic>
#include <functional>
#include <span>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace vs {
struct SmapsRegion;
enum class MappingKind : uint8_t;
class ObjectIdTable;
class ElfCache;
} // namespace vs

class VSLinuxPlatform : public VSPlatform {
public:
    VSLinuxPlatform();
    ~VSLinuxPlatform() override;

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
    VSReturnCode region_recurse(VSTaskHandle task, uint64_t &address, uint64_t &size,
                                uint32_t &depth, VSRegionInfo &info,
                                uint32_t &infoCount) override;
    VSReturnCode region_info(VSTaskHandle task, uint64_t &address, uint64_t &size, int32_t flavor,
                             VSRegionBasicInfo &info, uint32_t &infoCount,
                             uint32_t &objectName) override;
    VSReturnCode region_parts(VSTaskHandle task, uint64_t address, std::vector<VSRegionInfo> &parts) override;
    bool prepare_task_walk(VSTaskHandle task) override;
    bool resolve_shared_pages() override;
    VSReturnCode page_range_query(VSTaskHandle task, uint64_t address, uint64_t length,
                                  std::span<int32_t> dispositions, uint64_t &count) override;
    VSReturnCode purgeable_control(VSTaskHandle task, uint64_t address, int32_t operation,
                                   int32_t &state) override;
    VSReturnCode task_memory_info(VSTaskHandle task, VSTaskKernelMemoryInfo &info,
                                  uint32_t &count) override;
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

    // Where procfs is mounted.
    static constexpr const char *kProcRoot = "/proc";

    // The regions of a task as parsed from smaps, for tests and tools that
    // want the Linux view (path, device, inode) beside the records.
    // Returns the region query code (0 on success).
    VSReturnCode task_regions(VSTaskHandle task, std::vector<vs::SmapsRegion> &regions);

    // The pid a handle was opened for, or -1.
    int32_t task_pid(VSTaskHandle task);

private:
    struct Task;
    struct KernelArrays;

    std::shared_ptr<Task> _task(VSTaskHandle handle);
    // The task of the most recent handle opened for a pid, or null.
    std::shared_ptr<Task> _newestTaskForPid(int32_t pid);
    VSTaskHandle _registerTask(std::shared_ptr<Task> task);
    // Parses smaps once per task; returns the region query code.
    VSReturnCode _ensureParsed(Task &task);
    VSReturnCode _parse(Task &task);
    // Forgets the parse; the next region query parses again.
    void _releaseParse(Task &task);
    // The records of every region's parts, from the parse and, once the
    // run's shared pages are resolved, the shared-page index.
    void _buildParts(Task &task);
    // Adds the file pages a shared or private window holds to the index;
    // true when the mapping's own counts may fall short of the object's.
    bool _addWindow(int pagemapFd, const vs::SmapsRegion &region, vs::MappingKind kind);
    // The keys (frame, or swap entry) of a private mapping's anonymous
    // pages that other processes may map too, appended as runs.
    void _candidateKeys(int pagemapFd, const vs::SmapsRegion &region, std::vector<vs::KeyRun> &runs,
                        bool *framesUnreadable);
    // Reads pagemap entries of `pages` pages from `address` in large
    // batches; `batch` gets each with the index of its first page and
    // returns false to stop. `held` is how many pages the range holds by
    // smaps: a range mostly held is read whole, a sparse one only where it
    // holds pages. False when nothing could be read.
    bool _readPagemap(int pagemapFd, uint64_t address, uint64_t pages, uint64_t held,
                      const std::function<bool(std::span<const uint64_t>, uint64_t)> &batch);
    // Calls `dirty` with the index paired with every frame kpageflags marks
    // dirty; `frames` holds (frame, index) pairs and is sorted on the way.
    void _forEachDirtyFrame(std::vector<std::pair<uint64_t, uint64_t>> &frames,
                            const std::function<void(uint64_t)> &dirty);
    // The mount table, read once: tmpfs devices, and which devices hold
    // file systems whose files may be opened for a header probe.
    void _readMounts();
    const std::vector<uint64_t> &_tmpfsDevices();
    const std::unordered_map<uint64_t, bool> &_openableDevices();

    uint64_t _pageSize;
    std::mutex _tasksMutex;
    std::unordered_map<VSTaskHandle, std::shared_ptr<Task>> _tasks;
    // The walk asks for file names by pid; this finds the parse to answer from.
    std::unordered_multimap<int32_t, VSTaskHandle> _handlesByPid;
    VSTaskHandle _lastHandle = 0;

    // What the last listing opened and read of each process, for the
    // record and the task handle that follow it at once: the directory fd
    // (taken by the handle) and the parsed stat (taken by the record).
    struct Listed;
    std::mutex _listedMutex;
    std::unordered_map<int32_t, std::shared_ptr<Listed>> _listed;

    // Files kept open to save opening them again only get fds below this.
    int _keptFdLimit = 512;

    std::mutex _missingSettingsMutex;
    std::unordered_set<std::string> _missingSettings;

    std::once_flag _mountsOnce;
    std::vector<uint64_t> _tmpfs;
    std::unordered_map<uint64_t, bool> _openable;

    vs::SharedPageIndex _sharedPages;
    std::atomic<bool> _sharedPagesResolved{false};
    std::atomic<bool> _sharedFramesUnreadable{false};
    // Bytes of page keys tasks keep from preparation to walk, at most the budget.
    static constexpr size_t kStoredKeyBudget = 16u << 20;
    std::atomic<size_t> _storedKeyBytes{0};

    std::once_flag _kpageflagsOnce;
    int _kpageflagsFd = -1;

    // The kernel's zero page: every process that reads anonymous memory it
    // never wrote maps it, and it is nobody's memory. 0 when unknown.
    uint64_t _zeroFrame();
    std::once_flag _zeroFrameOnce;
    uint64_t _zeroPage = 0;

    std::once_flag _swapOnce;
    bool _swapConfigured = false;

    std::once_flag _argumentAreaOnce;
    int32_t _argumentAreaSize = 0;

    std::mutex _kernelArraysMutex;
    std::vector<std::shared_ptr<KernelArrays>> _kernelArrays;
};
