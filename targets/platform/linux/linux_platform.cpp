#include "targets/platform/linux/linux_platform.h"

#include "model/memory_region.h"
#include "targets/platform/linux/elf_images.h"
#include "targets/platform/linux/object_ids.h"
#include "targets/platform/linux/proc_reader.h"
#include "targets/platform/linux/proc_text.h"
#include "targets/platform/linux/region_records.h"
#include "targets/platform/linux/smaps_parser.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <elf.h>
#include <fcntl.h>
#include <malloc.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <thread>
#include <unistd.h>

using vs::ReadBuffer;
using vs::SmapsRegion;
using vs::UniqueFd;

namespace {

int openProc(int32_t pid, int flags) {
    char path[64];
    std::snprintf(path, sizeof path, "%s/%d", VSLinuxPlatform::kProcRoot, pid);
    return ::open(path, flags | O_CLOEXEC);
}

// A process's /proc directory for the time one query reads through it:
// the one its handle holds, or one opened for the query alone.
class ProcessDir {
public:
    static ProcessDir held(int fd) {
        ProcessDir dir;
        dir._fd = fd;
        return dir;
    }
    static ProcessDir opened(UniqueFd fd) {
        ProcessDir dir;
        dir._fd = fd.get();
        dir._opened = std::move(fd);
        return dir;
    }
    static ProcessDir failed(int error) {
        ProcessDir dir;
        dir._error = error;
        return dir;
    }
    // -1 when the process could not be reached; error() then says why.
    int get() const { return _fd; }
    int error() const { return _error; }

private:
    UniqueFd _opened;
    int _fd = -1;
    int _error = 0;
};

} // namespace

struct VSLinuxPlatform::Listed {
    UniqueFd dir;
    std::optional<vs::ProcStat> stat;
};

struct VSLinuxPlatform::Task {
    // The memory lines of /proc/PID/status that the process-wide counters use.
    struct StatusFigures {
        std::optional<uint64_t> anon, shmem, swap, pte, peak, threads, rss;

        explicit StatusFigures(std::string_view status)
            : anon(vs::statusBytes(status, "RssAnon")),
              shmem(vs::statusBytes(status, "RssShmem")),
              swap(vs::statusBytes(status, "VmSwap")),
              pte(vs::statusBytes(status, "VmPTE")),
              peak(vs::statusBytes(status, "VmHWM")),
              threads(vs::statusBytes(status, "Threads")),
              rss(vs::statusBytes(status, "VmRSS")) {}
    };

    int32_t pid = 0;
    // Held while fds are plentiful. Otherwise every query opens /proc/PID
    // again, and the start time tells whether the pid still names this
    // process: a pid reused by another one reads as this one gone. (The
    // time is in clock ticks; a pid handed on within one tick would need
    // the whole pid space to wrap meanwhile.)
    UniqueFd dir;
    uint64_t startTime = 0;

    // Both are set when the handle is made and never change, so they are
    // read without the lock.
    ProcessDir openDir() const {
        if (dir.valid()) {
            return ProcessDir::held(dir.get());
        }
        UniqueFd opened(openProc(pid, O_RDONLY | O_DIRECTORY));
        if (!opened.valid()) {
            return ProcessDir::failed(errno == ENOENT ? ESRCH : errno);
        }
        std::string_view text;
        const int error = vs::readOnePieceFileAt(opened.get(), "stat", text);
        if (error != 0) {
            return ProcessDir::failed(error == ENOENT ? ESRCH : error);
        }
        const std::optional<vs::ProcStat> st = vs::parseStat(text);
        if (!st || st->startTime != startTime) {
            return ProcessDir::failed(ESRCH);
        }
        return ProcessDir::opened(std::move(opened));
    }
    // Invalid when the process cannot be reached or its frames not read.
    UniqueFd openPagemap() const {
        const ProcessDir at = openDir();
        return UniqueFd(at.get() < 0 ? -1 : ::openat(at.get(), "pagemap", O_RDONLY | O_CLOEXEC));
    }

    std::mutex mutex; // guards everything below
    // smaps, opened with the handle (the open is where the kernel checks
    // the right to read the process) and read by the first parse.
    UniqueFd smaps;
    bool parsed = false;
    VSReturnCode parseCode = 0;
    std::vector<SmapsRegion> regions;
    std::vector<vs::MappingKind> kinds;
    std::vector<uint32_t> tags;
    size_t walkHint = 0; // where the last region query found its region
    // The records of every region, one per part, packed: region i's parts
    // are the bytes parts[firstPart[i]] to parts[firstPart[i + 1]]. Built on the first
    // region query, after the run's shared pages are resolved.
    bool partsBuilt = false;
    std::vector<uint8_t> parts;
    std::vector<uint32_t> firstPart;

    // Prepared for the run's shared-page resolution: its pages are in the
    // index, so its walk looks them up there (kept across parses).
    bool prepared = false;
    // The keys prepare_task_walk read, by mapping, kept for the first walk
    // so that it need not read the frames again; dropped once used.
    struct StoredKeys {
        uint64_t start, end;
        size_t begin, length; // within storedBytes
    };
    std::vector<StoredKeys> storedKeys;
    std::vector<uint8_t> storedBytes;
    // A prepared parse waiting for the run is held packed (a run holds
    // every waiting target's at once); the first region query unpacks it.
    vs::PackedSmapsRegions packed;
    // The status read for the kernel-memory counters, kept for the one
    // resource-usage query that a target makes right after it (both are
    // taken at construction); used once, then dropped.
    std::optional<StatusFigures> status;
};

namespace {

// Kernel stack of one thread (THREAD_SIZE) on the architectures we build for.
constexpr uint64_t kKernelStackSize = 16 * 1024;

// A pagemap entry (8 bytes per page) and a kpageflags word.
constexpr uint64_t kPagemapPresent = 1ull << 63;
constexpr uint64_t kPagemapSwapped = 1ull << 62;
constexpr uint64_t kPagemapFileOrSharedAnon = 1ull << 61;
constexpr uint64_t kPagemapGuard = 1ull << 58; // a guard marker, which also sets "swapped"
constexpr uint64_t kPagemapExclusive = 1ull << 56;
constexpr uint64_t kPagemapPfnMask = (1ull << 55) - 1;
constexpr uint64_t kPageFlagDirty = 1ull << 4; // KPF_DIRTY

// Region queries keep 1 and 4 for their own meanings, so the two errnos with
// those numbers are reported as their nearest neighbours.
VSReturnCode regionErrno(int error) {
    if (error == EPERM) {
        return EACCES;
    }
    if (error == EINTR) {
        return EIO;
    }
    return error;
}

void copyName(char *field, size_t fieldSize, std::string_view text) {
    std::memset(field, 0, fieldSize);
    std::memcpy(field, text.data(), std::min(fieldSize, text.size()));
}

bool hostIs64Bit() {
    return sizeof(void *) == 8;
}

// True when the process behind `dirFd` has gone or is going: reaped, a
// zombie, dead, or past the point where its address space was torn down.
bool processHasGone(int dirFd) {
    char buffer[1024];
    const int64_t n = vs::readBytesAt(dirFd, "stat", 0, buffer, sizeof buffer - 1);
    if (n <= 0) {
        return n == -ESRCH || n == -ENOENT || n == 0;
    }
    const auto st = vs::parseStat(std::string_view(buffer, static_cast<size_t>(n)));
    if (!st) {
        return false;
    }
    return vs::statSaysGone(*st);
}

std::vector<uint64_t> threadStackPointers(int dirFd) {
    std::vector<uint64_t> pointers;
    const int taskFd = ::openat(dirFd, "task", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (taskFd < 0) {
        return pointers;
    }
    DIR *dir = ::fdopendir(taskFd);
    if (dir == nullptr) {
        ::close(taskFd);
        return pointers;
    }
    while (const dirent *entry = ::readdir(dir)) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') {
            continue;
        }
        char name[sizeof entry->d_name + 16];
        std::snprintf(name, sizeof name, "%s/syscall", entry->d_name);
        char text[256];
        const int64_t n = vs::readBytesAt(taskFd, name, 0, text, sizeof text);
        if (n <= 0) {
            continue;
        }
        if (auto sp = vs::parseSyscallStackPointer(std::string_view(text, static_cast<size_t>(n)))) {
            pointers.push_back(*sp);
        }
    }
    ::closedir(dir); // closes taskFd
    std::sort(pointers.begin(), pointers.end());
    return pointers;
}

// Reads bytes of a file another process maps, opened through `name` under
// `dirFd`. The open can neither block on a FIFO nor take a terminal, and
// whatever it reaches must be the regular file (device, inode) the process
// maps: a path may name another file by now. -errno on failure.
int64_t readFileOfProcess(int dirFd, const char *name, int flags, uint64_t device, uint64_t inode,
                          uint64_t offset, void *out, size_t size) {
    UniqueFd fd(::openat(dirFd, name, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC | flags));
    if (!fd.valid()) {
        return -errno;
    }
    struct stat st {};
    if (::fstat(fd.get(), &st) != 0) {
        return -errno;
    }
    if (!S_ISREG(st.st_mode) || st.st_ino != inode || vs::deviceNumber(major(st.st_dev), minor(st.st_dev)) != device) {
        return -ENOENT;
    }
    size_t done = 0;
    while (done < size) {
        const ssize_t n = ::pread(fd.get(), static_cast<char *>(out) + done, size - done,
                                  static_cast<off_t>(offset + done));
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return -errno;
        }
        if (n == 0) {
            break;
        }
        done += static_cast<size_t>(n);
    }
    return static_cast<int64_t>(done);
}

// What a header probe of one process may use.
struct MappedFileContext {
    int dirFd;
    const std::vector<SmapsRegion> &regions;
    uint64_t pageSize;
    // Whether files on a device may be opened for a probe (a local file
    // system); devices missing here are not opened.
    const std::unordered_map<uint64_t, bool> &openableDevices;
    bool memoryOpened = false;
    UniqueFd pagemap;
    UniqueFd mem;
};

// Reads file bytes out of the process's own mapping of the file, but only
// from pages it has present: nothing is faulted in, no file is opened, so
// the read can neither start I/O nor wait for a file system. -ENODATA when
// the process does not hold all the pages asked for.
int64_t readFileFromMemory(MappedFileContext &c, const SmapsRegion &file, uint64_t offset, void *out,
                           size_t size) {
    for (const SmapsRegion &mapping : c.regions) {
        if (mapping.inode != file.inode || mapping.devMajor != file.devMajor ||
            mapping.devMinor != file.devMinor || offset < mapping.offset ||
            offset - mapping.offset >= mapping.size() || size > mapping.size() - (offset - mapping.offset)) {
            continue;
        }
        if (!c.memoryOpened) {
            c.memoryOpened = true;
            c.pagemap = UniqueFd(::openat(c.dirFd, "pagemap", O_RDONLY | O_CLOEXEC));
            c.mem = UniqueFd(::openat(c.dirFd, "mem", O_RDONLY | O_CLOEXEC));
        }
        if (!c.pagemap.valid() || !c.mem.valid()) {
            return -ENODATA;
        }
        const uint64_t address = mapping.start + (offset - mapping.offset);
        const uint64_t first = address / c.pageSize;
        const uint64_t last = (address + size + c.pageSize - 1) / c.pageSize;
        std::vector<uint64_t> entries(last - first);
        const ssize_t n = ::pread(c.pagemap.get(), entries.data(), entries.size() * sizeof(uint64_t),
                                  static_cast<off_t>(first * sizeof(uint64_t)));
        if (n != static_cast<ssize_t>(entries.size() * sizeof(uint64_t))) {
            return n < 0 ? -errno : -ENODATA;
        }
        for (uint64_t entry : entries) {
            if ((entry & kPagemapPresent) == 0) {
                return -ENODATA;
            }
        }
        const ssize_t got = ::pread(c.mem.get(), out, size, static_cast<off_t>(address));
        return got < 0 ? -errno : got;
    }
    return -ENODATA;
}

// Reads a file the process maps: from the process's memory where its pages
// are present, else by opening the mapped file itself through map_files/
// (which also reaches deleted files) or, when that is refused, through the
// process's root. Files on file systems that may not answer are not opened.
int64_t readMappedFile(void *context, const SmapsRegion &region, uint64_t offset, void *out, size_t size) {
    auto &c = *static_cast<MappedFileContext *>(context);
    if (region.hasFlag(vs::kVmIo) || region.hasFlag(vs::kVmPfnMap)) {
        return -ENODEV; // a device: opening one can act
    }
    const int64_t fromMemory = readFileFromMemory(c, region, offset, out, size);
    if (fromMemory != -ENODATA) {
        return fromMemory;
    }
    const uint64_t device = vs::deviceNumber(region.devMajor, region.devMinor);
    const auto openable = c.openableDevices.find(device);
    if (openable == c.openableDevices.end() || !openable->second) {
        return -EAGAIN; // not worth remembering: another process may hold the pages
    }
    char name[64];
    std::snprintf(name, sizeof name, "map_files/%llx-%llx", static_cast<unsigned long long>(region.start),
                  static_cast<unsigned long long>(region.end));
    // map_files entries are links by nature: they cannot be opened without
    // following, and lead to exactly the mapped file.
    const int64_t n = readFileOfProcess(c.dirFd, name, 0, device, region.inode, offset, out, size);
    if (n >= 0 || n == -ESRCH) {
        return n;
    }
    const std::string rooted = "root" + region.path.str();
    return readFileOfProcess(c.dirFd, rooted.c_str(), O_NOFOLLOW, device, region.inode, offset, out, size);
}

// Index of the first region ending above `address`, or regions.size().
size_t regionAtOrAbove(const std::vector<SmapsRegion> &regions, uint64_t address) {
    auto it = std::upper_bound(regions.begin(), regions.end(), address,
                               [](uint64_t a, const SmapsRegion &r) { return a < r.end; });
    return static_cast<size_t>(it - regions.begin());
}

// The same, looking first where the last answer was: the walk asks for
// the regions in address order, each a few times (record, parts, basic
// record), and a search of a million regions misses the cache at every step.
size_t regionAtOrAbove(const std::vector<SmapsRegion> &regions, uint64_t address, size_t &hint) {
    const size_t last = std::min(hint + 2, regions.size());
    for (size_t i = hint; i < last; ++i) {
        if (regions[i].end > address && (i == 0 || regions[i - 1].end <= address)) {
            return hint = i;
        }
    }
    return hint = regionAtOrAbove(regions, address);
}

// Reads /proc/PID/<name> into the thread's buffer. 0 or the errno.
int readPidFile(int32_t pid, const char *name, std::string_view &text, bool onePiece = false) {
    char path[96];
    std::snprintf(path, sizeof path, "%s/%d/%s", VSLinuxPlatform::kProcRoot, pid, name);
    return onePiece ? vs::readOnePieceFileAt(AT_FDCWD, path, text) : vs::readFileAt(AT_FDCWD, path, text);
}

} // namespace

VSLinuxPlatform::VSLinuxPlatform() : _pageSize(static_cast<uint64_t>(::sysconf(_SC_PAGESIZE))) {
    // A run keeps the regions of every process until its report is printed.
    // What the gathering threads only need for a while (parses, the kernel's
    // tables) must go back for that: one heap for all threads, so that the
    // report reuses what they freed instead of leaving it in arenas of their
    // own, and large blocks mapped on their own, so that freeing one returns
    // it (the C library would otherwise raise that limit as it goes).
    ::mallopt(M_ARENA_MAX, 1);
    ::mallopt(M_MMAP_THRESHOLD, 256 * 1024);
    // A task handle holds its directory fd, and a run over all processes
    // makes one per process: lift the soft fd limit so that most can.
    rlimit files{};
    if (::getrlimit(RLIMIT_NOFILE, &files) == 0) {
        if (files.rlim_cur < files.rlim_max) {
            files.rlim_cur = files.rlim_max;
            ::setrlimit(RLIMIT_NOFILE, &files);
            ::getrlimit(RLIMIT_NOFILE, &files);
        }
        // Directories and files are kept open only to save opening them
        // again, while half of the fds are free and never into what every
        // gathering thread opens for a while (a handful each). Beyond that
        // a handle opens its directory for each query.
        const rlim_t threads = std::max(1u, std::thread::hardware_concurrency());
        const rlim_t inUse = 16 + 8 * threads;
        const rlim_t kept = std::min(files.rlim_cur / 2, files.rlim_cur > inUse ? files.rlim_cur - inUse : 0);
        _keptFdLimit = static_cast<int>(std::min<rlim_t>(kept, INT_MAX));
    }
}

VSLinuxPlatform::~VSLinuxPlatform() {
    if (_kpageflagsFd >= 0) {
        ::close(_kpageflagsFd);
    }
}

// ---- processes ---------------------------------------------------------------------

int32_t VSLinuxPlatform::list_all_pids(std::span<int32_t> buffer) {
    DIR *dir = ::opendir(kProcRoot);
    if (dir == nullptr) {
        return -1;
    }
    std::vector<int32_t> pids;
    pids.push_back(0); // the kernel stands for all kernel threads
    const bool counting = buffer.empty();
    std::unordered_map<int32_t, std::shared_ptr<Listed>> listed;
    while (const dirent *entry = ::readdir(dir)) {
        const char *name = entry->d_name;
        if (name[0] < '1' || name[0] > '9') {
            continue;
        }
        char *end = nullptr;
        const long pid = std::strtol(name, &end, 10);
        if (*end != '\0' || pid <= 0 || pid > INT32_MAX) {
            continue;
        }
        if (!counting) {
            // Kernel threads are left out, which takes their stat; the
            // record and the handle of every other process are asked for
            // next, so keep what was read and, while fds are plentiful, the
            // directory it was read through.
            auto process = std::make_shared<Listed>();
            process->dir = UniqueFd(::openat(::dirfd(dir), name, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
            std::string_view text;
            if (!process->dir.valid() || vs::readOnePieceFileAt(process->dir.get(), "stat", text) != 0) {
                continue; // exited meanwhile
            }
            process->stat = vs::parseStat(text);
            if (process->dir.get() >= _keptFdLimit) {
                process->dir = UniqueFd();
            }
            if (!process->stat || (process->stat->flags & vs::kLinuxKernelThreadFlag) != 0) {
                continue;
            }
            listed.emplace(static_cast<int32_t>(pid), std::move(process));
        }
        pids.push_back(static_cast<int32_t>(pid));
    }
    ::closedir(dir);
    if (counting) {
        return static_cast<int32_t>(pids.size());
    }
    {
        std::lock_guard<std::mutex> lock(_listedMutex);
        _listed.swap(listed); // what an earlier listing kept is dropped
    }
    std::sort(pids.begin(), pids.end());
    const size_t stored = std::min(pids.size(), buffer.size());
    std::copy_n(pids.begin(), stored, buffer.begin());
    return static_cast<int32_t>(stored);
}

int32_t VSLinuxPlatform::pid_bsd_info(int32_t pid, VSBsdInfo &info) {
    info = VSBsdInfo{};
    if (pid == 0) {
        info.flags = vs::kBsdInfoFlagSystem | (hostIs64Bit() ? vs::kBsdInfoFlag64Bit : 0);
        copyName(info.commandName, sizeof info.commandName, "kernel");
        copyName(info.name, sizeof info.name, "kernel");
        return sizeof(VSBsdInfo);
    }
    if (pid < 0) {
        return 0;
    }
    // The stat the listing read moments ago serves once; asked again, the
    // record is read anew.
    std::optional<vs::ProcStat> st;
    std::shared_ptr<Listed> listed; // keeps its directory open while in use
    {
        std::lock_guard<std::mutex> lock(_listedMutex);
        if (auto it = _listed.find(pid); it != _listed.end()) {
            listed = it->second;
            st.swap(listed->stat);
        }
    }
    UniqueFd ownDir;
    int dirFd = listed ? listed->dir.get() : -1;
    if (dirFd < 0) {
        ownDir = UniqueFd(openProc(pid, O_RDONLY | O_DIRECTORY));
        dirFd = ownDir.get();
        if (dirFd < 0) {
            return 0;
        }
    }
    if (!st) {
        std::string_view text;
        if (vs::readOnePieceFileAt(dirFd, "stat", text) != 0) {
            return 0;
        }
        st = vs::parseStat(text);
        if (!st) {
            return 0;
        }
    }
    info.pid = static_cast<uint32_t>(pid);
    info.ppid = static_cast<uint32_t>(st->ppid);
    copyName(info.commandName, sizeof info.commandName, st->comm);
    copyName(info.name, sizeof info.name, st->comm);

    // The width is the executable's ELF class. Most processes run one of a
    // few programs: their headers are read once per file, through the first
    // process met that runs it.
    bool is64 = hostIs64Bit();
    // Asked without syncing, so that a FUSE or network file system is not
    // asked about the file; its device tells whether it may be opened.
    struct statx exe {};
    if (::statx(dirFd, "exe", AT_STATX_DONT_SYNC, STATX_TYPE | STATX_INO, &exe) == 0 && S_ISREG(exe.stx_mode)) {
        const uint64_t device = vs::deviceNumber(exe.stx_dev_major, exe.stx_dev_minor);
        const auto openable = _openableDevices().find(device);
        if (openable != _openableDevices().end() && openable->second) {
            struct ExeContext {
                int dirFd;
                uint64_t device, inode;
            } context{dirFd, device, exe.stx_ino};
            auto readExe = [](void *context, uint64_t offset, void *out, size_t size) {
                const auto &c = *static_cast<const ExeContext *>(context);
                return readFileOfProcess(c.dirFd, "exe", 0, c.device, c.inode, offset, out, size);
            };
            if (auto program = vs::ElfCache::shared().lookup(device, exe.stx_ino, readExe, &context)) {
                is64 = program->is64bit;
            }
        }
    }
    if (is64) {
        info.flags |= vs::kBsdInfoFlag64Bit;
    }
    return sizeof(VSBsdInfo);
}

int32_t VSLinuxPlatform::pid_short_info(int32_t pid, VSShortInfo &info, int32_t &errorNumber) {
    info = VSShortInfo{};
    errorNumber = 0;
    std::string_view text;
    const int error = pid > 0 ? readPidFile(pid, "stat", text, true) : ESRCH;
    if (error != 0) {
        errorNumber = (error == ENOENT || error == ESRCH) ? vs::kErrorNoSuchProcess : error;
        return 0;
    }
    const auto st = vs::parseStat(text);
    if (!st) {
        errorNumber = vs::kErrorNoSuchProcess;
        return 0;
    }
    // Exiting: its memory is being torn down and reads empty. It has gone
    // for every purpose of a report, which says so instead of an error.
    if (st->state != 'Z' && st->state != 'X' && vs::statSaysGone(*st)) {
        errorNumber = vs::kErrorNoSuchProcess;
        return 0;
    }
    switch (st->state) {
    case 'Z':
    case 'X':
        info.runStatus = vs::kRunStatusZombie;
        break;
    case 'T':
    case 't':
        info.runStatus = 4; // stopped
        break;
    case 'R':
        info.runStatus = 2; // runnable
        break;
    default:
        info.runStatus = 3; // sleeping
        break;
    }
    return sizeof(VSShortInfo);
}

int32_t VSLinuxPlatform::pid_dirty_flags(int32_t, uint32_t &flags) {
    // No idle-exit tracking on Linux: every process is "unsupported".
    flags = 0;
    return 0;
}

int32_t VSLinuxPlatform::pid_resource_usage(int32_t pid, int32_t version,
                                            VSResourceUsageInfo &info) {
    info = VSResourceUsageInfo{};
    if (version != vs::kResourceUsageVersion4 || pid <= 0) {
        return EINVAL;
    }
    // A target asks right after its kernel-memory counters, which read the
    // same file through its handle: answer from that read when there is one.
    std::optional<Task::StatusFigures> kept;
    if (std::shared_ptr<Task> task = _newestTaskForPid(pid)) {
        std::lock_guard<std::mutex> lock(task->mutex);
        kept.swap(task->status);
    }
    if (!kept) {
        std::string_view status;
        const int error = readPidFile(pid, "status", status, true);
        if (error != 0) {
            return error == ENOENT ? ESRCH : error;
        }
        kept.emplace(status);
    }
    const auto &[anon, shmem, swap, pte, peak, threads, rss] = *kept;
    if (!anon || !shmem || !swap || !pte || !peak) {
        return ESRCH; // a zombie has no memory lines
    }
    // Swapped shmem pages are not in the page tables, so VmSwap misses
    // them; smaps has them per mapping. Only worth a read when swap exists.
    uint64_t shmemSwap = 0;
    std::call_once(_swapOnce, [this] {
        std::string_view meminfo;
        if (vs::readFileAt(AT_FDCWD, "/proc/meminfo", meminfo) == 0) {
            _swapConfigured = vs::statusBytes(meminfo, "SwapTotal").value_or(0) > 0;
        }
    });
    if (_swapConfigured) {
        std::string_view smaps;
        if (readPidFile(pid, "smaps", smaps) == 0) {
            std::vector<SmapsRegion> regions;
            vs::parseSmaps(smaps, regions);
            for (const SmapsRegion &r : regions) {
                if (vs::mappingKind(r, _tmpfsDevices()) == vs::MappingKind::SharedMemory) {
                    shmemSwap += r.swap;
                }
            }
        }
    }
    info.physVestage = *anon + *shmem + *swap + shmemSwap + *pte;
    info.lifetimeMaxPhysVestage = *peak;
    info.residentSize = rss.value_or(0);
    return 0;
}

int32_t VSLinuxPlatform::pid_region_filename(int32_t pid, uint64_t address,
                                             std::span<char> buffer) {
    // Answered from the parse of a handle for the pid: the first parsed one.
    // Handles and tasks are only locked one after the other, never the
    // other way round.
    std::string_view path;
    bool found = false;
    std::shared_ptr<Task> held; // keeps the task whose path is read
    std::unique_lock<std::mutex> taskLock;
    {
        std::lock_guard<std::mutex> lock(_tasksMutex);
        auto [first, last] = _handlesByPid.equal_range(pid);
        for (auto it = first; it != last && !held; ++it) {
            const std::shared_ptr<Task> &task = _tasks.at(it->second);
            std::unique_lock<std::mutex> candidateLock(task->mutex);
            if (!task->parsed || task->parseCode != 0) {
                continue;
            }
            held = task;
            taskLock = std::move(candidateLock);
        }
    }
    if (held) {
        _ensureParsed(*held); // unpacks a parse that waited for the run
        const size_t i = regionAtOrAbove(held->regions, address);
        if (i < held->regions.size() && held->regions[i].start <= address) {
            path = held->regions[i].path;
            found = true;
        }
    }
    std::vector<SmapsRegion> mapsRegions;
    if (!found) {
        taskLock = {};
        std::string_view maps;
        if (pid <= 0 || readPidFile(pid, "maps", maps) != 0) {
            return 0;
        }
        vs::parseSmaps(maps, mapsRegions);
        const size_t i = regionAtOrAbove(mapsRegions, address);
        if (i >= mapsRegions.size() || mapsRegions[i].start > address) {
            return 0;
        }
        path = mapsRegions[i].path;
    }
    if (path.empty() || path[0] == '[') {
        return 0; // anonymous memory and the kernel's pseudo mappings
    }
    const size_t length = std::min(path.size(), buffer.size());
    std::memcpy(buffer.data(), path.data(), length);
    return static_cast<int32_t>(length);
}

int32_t VSLinuxPlatform::argument_area_max_size(int32_t &size) {
    // The arguments and environment share ARG_MAX; the area adds the
    // executable path and the count in front. Asked once per target, it
    // is worked out once (the C library asks the kernel every time).
    std::call_once(_argumentAreaOnce, [this] {
        long argMax = ::sysconf(_SC_ARG_MAX);
        if (argMax <= 0 || argMax > 16 * 1024 * 1024) {
            argMax = 2 * 1024 * 1024;
        }
        _argumentAreaSize = static_cast<int32_t>(argMax + PATH_MAX + 16);
    });
    size = _argumentAreaSize;
    return 0;
}

int32_t VSLinuxPlatform::process_argument_area(int32_t pid, std::span<char> buffer,
                                               size_t &length) {
    length = 0;
    if (pid <= 0) {
        return ESRCH;
    }
    // A target names itself right after opening its task: read through the
    // directory its handle holds rather than open /proc/PID once more.
    ProcessDir dir;
    if (std::shared_ptr<Task> task = _newestTaskForPid(pid)) {
        dir = task->openDir();
    } else if (UniqueFd opened(openProc(pid, O_RDONLY | O_DIRECTORY)); opened.valid()) {
        dir = ProcessDir::opened(std::move(opened));
    } else {
        dir = ProcessDir::failed(errno == ENOENT ? ESRCH : errno);
    }
    const int dirFd = dir.get();
    if (dirFd < 0) {
        return dir.error();
    }
    char exe[PATH_MAX + 1];
    const ssize_t exeLength = ::readlinkat(dirFd, "exe", exe, PATH_MAX);
    if (exeLength <= 0) {
        return exeLength == 0 ? ENOENT : errno;
    }
    std::string_view exePath(exe, static_cast<size_t>(exeLength));
    constexpr std::string_view kDeleted = " (deleted)";
    if (exePath.size() > kDeleted.size() && exePath.ends_with(kDeleted)) {
        exePath.remove_suffix(kDeleted.size()); // the name is what matters
    }
    std::string_view cmdline;
    if (vs::readOnePieceFileAt(dirFd, "cmdline", cmdline) != 0) {
        cmdline = {};
    }

    // count, executable path, zero padding to the pointer size, arguments
    std::string area(sizeof(uint32_t), '\0');
    const uint32_t argc = vs::countArguments(cmdline);
    std::memcpy(area.data(), &argc, sizeof argc);
    area.append(exePath);
    area.push_back('\0');
    while (area.size() % sizeof(void *) != 0) {
        area.push_back('\0');
    }
    area.append(cmdline);
    length = std::min(area.size(), buffer.size());
    std::memcpy(buffer.data(), area.data(), length);
    return 0;
}

uint64_t VSLinuxPlatform::target_platform_code(int32_t, bool) {
    return VSPlatformNone;
}

// ---- tasks -------------------------------------------------------------------------------

std::shared_ptr<VSLinuxPlatform::Task> VSLinuxPlatform::_newestTaskForPid(int32_t pid) {
    std::lock_guard<std::mutex> lock(_tasksMutex);
    auto [first, last] = _handlesByPid.equal_range(pid);
    if (first == last) {
        return nullptr;
    }
    VSTaskHandle newest = first->second;
    for (auto it = first; it != last; ++it) {
        newest = std::max(newest, it->second);
    }
    return _tasks.at(newest);
}

std::shared_ptr<VSLinuxPlatform::Task> VSLinuxPlatform::_task(VSTaskHandle handle) {
    std::lock_guard<std::mutex> lock(_tasksMutex);
    auto it = _tasks.find(handle);
    return it == _tasks.end() ? nullptr : it->second;
}

VSTaskHandle VSLinuxPlatform::_registerTask(std::shared_ptr<Task> task) {
    std::lock_guard<std::mutex> lock(_tasksMutex);
    do {
        ++_lastHandle;
    } while (_lastHandle == vs::kTaskHandleNone || _lastHandle == vs::kPortDead ||
             _tasks.count(_lastHandle) != 0);
    _handlesByPid.emplace(task->pid, _lastHandle);
    _tasks.emplace(_lastHandle, std::move(task));
    return _lastHandle;
}

VSReturnCode VSLinuxPlatform::task_handle_for_pid(int32_t pid, VSTaskHandle &task) {
    task = vs::kTaskHandleNone;
    if (pid <= 0) {
        return ESRCH;
    }
    auto entry = std::make_shared<Task>();
    entry->pid = pid;
    {
        // The directory the listing opened names the process it listed.
        std::lock_guard<std::mutex> lock(_listedMutex);
        auto it = _listed.find(pid);
        if (it != _listed.end()) {
            entry->dir = std::move(it->second->dir);
            _listed.erase(it);
        }
    }
    if (!entry->dir.valid()) {
        entry->dir = UniqueFd(openProc(pid, O_RDONLY | O_DIRECTORY));
        if (!entry->dir.valid()) {
            return errno == ENOENT ? ESRCH : errno;
        }
    }
    // Whether the process may be read at all shows when its smaps opens.
    entry->smaps = UniqueFd(::openat(entry->dir.get(), "smaps", O_RDONLY | O_CLOEXEC));
    if (!entry->smaps.valid()) {
        return errno;
    }
    if (entry->smaps.get() >= _keptFdLimit) {
        entry->smaps = UniqueFd(); // opened again by the parse
    }
    if (entry->dir.get() >= _keptFdLimit) {
        std::string_view text;
        const int error = vs::readOnePieceFileAt(entry->dir.get(), "stat", text);
        const std::optional<vs::ProcStat> st = error == 0 ? vs::parseStat(text) : std::nullopt;
        if (!st) {
            return error == 0 || error == ENOENT ? ESRCH : error;
        }
        entry->startTime = st->startTime;
        entry->dir = UniqueFd();
    }
    task = _registerTask(std::move(entry));
    return 0;
}

VSReturnCode VSLinuxPlatform::release_task_handle(VSTaskHandle task) {
    std::lock_guard<std::mutex> lock(_tasksMutex);
    auto it = _tasks.find(task);
    if (it == _tasks.end()) {
        return EBADF;
    }
    auto [first, last] = _handlesByPid.equal_range(it->second->pid);
    for (auto byPid = first; byPid != last; ++byPid) {
        if (byPid->second == task) {
            _handlesByPid.erase(byPid);
            break;
        }
    }
    _tasks.erase(it);
    return 0;
}

void VSLinuxPlatform::_readMounts() {
    std::call_once(_mountsOnce, [this] {
        std::string_view mountinfo;
        if (vs::readFileAt(AT_FDCWD, "/proc/self/mountinfo", mountinfo) != 0) {
            return;
        }
        for (const vs::MountDevice &mount : vs::parseMountDevices(mountinfo)) {
            if (mount.type == "tmpfs") {
                _tmpfs.push_back(mount.device);
            }
            _openable[mount.device] = vs::mayProbeFileSystem(mount.type);
        }
    });
}

const std::vector<uint64_t> &VSLinuxPlatform::_tmpfsDevices() {
    _readMounts();
    return _tmpfs;
}

const std::unordered_map<uint64_t, bool> &VSLinuxPlatform::_openableDevices() {
    _readMounts();
    return _openable;
}

VSReturnCode VSLinuxPlatform::_parse(Task &task) {
    const ProcessDir dir = task.openDir();
    if (dir.get() < 0) {
        return dir.error() == ESRCH ? vs::kReturnDeadPort : regionErrno(dir.error());
    }
    // Parsed as it is read: the text of a process with many mappings is
    // never held whole.
    vs::SmapsParser parser(task.regions);
    const auto consume = [&parser](std::string_view text) { return parser.feed(text); };
    uint64_t bytes = 0;
    int error = 0;
    if (task.smaps.valid()) {
        error = vs::readInPieces(task.smaps.get(), vs::kRecordFileChunk, consume, bytes);
        // Opened before an exec, the file shows the address space the
        // process has left: empty. Its new one needs a new open.
        if (error == 0 && bytes == 0) {
            task.smaps = UniqueFd();
        }
    }
    if (!task.smaps.valid()) {
        task.smaps = UniqueFd(::openat(dir.get(), "smaps", O_RDONLY | O_CLOEXEC));
        error = task.smaps.valid() ? vs::readInPieces(task.smaps.get(), vs::kRecordFileChunk, consume, bytes) : errno;
    }
    task.smaps = UniqueFd(); // a parse asked for again reads anew
    if (error != 0) {
        std::vector<SmapsRegion>().swap(task.regions);
        return (error == ESRCH || error == ENOENT) ? vs::kReturnDeadPort : regionErrno(error);
    }
    if (task.regions.empty() && processHasGone(dir.get())) {
        return vs::kReturnDeadPort;
    }
    const std::vector<uint64_t> stackPointers = threadStackPointers(dir.get());
    const std::vector<uint64_t> &tmpfs = _tmpfsDevices();
    task.kinds.reserve(task.regions.size());
    task.tags.reserve(task.regions.size());
    for (const SmapsRegion &region : task.regions) {
        const vs::MappingKind kind = vs::mappingKind(region, tmpfs);
        task.kinds.push_back(kind);
        task.tags.push_back(vs::userTagFor(region, kind, stackPointers));
    }
    return 0;
}

void VSLinuxPlatform::_buildParts(Task &task) {
    if (task.partsBuilt) {
        return;
    }
    vs::ObjectIdTable &ids = vs::ObjectIdTable::shared();
    task.parts.clear();
    task.firstPart.clear();
    // About 24 bytes a part, most regions one part.
    task.parts.reserve(task.regions.size() * 24);
    task.firstPart.reserve(task.regions.size() + 1);
    const bool resolved = task.prepared && _sharedPagesResolved.load();
    UniqueFd pagemap;
    bool pagemapFailed = false;
    std::vector<vs::SharedAnonymousPart> shared;
    thread_local std::vector<vs::KeyRun> runs;
    thread_local std::vector<vs::SharedPageIndex::SetPages> sets;
    for (uint32_t i = 0; i < task.regions.size(); ++i) {
        const SmapsRegion &region = task.regions[i];
        const vs::MappingKind kind = task.kinds[i];
        shared.clear();
        std::optional<vs::ObjectPages> objectPages;
        if (resolved && vs::mayShareAnonymousPages(region, kind) && !pagemapFailed) {
            // The frames as first seen (or a second look at them): the index
            // knows which sets they are in now that every target was seen.
            runs.clear();
            const auto stored = std::find_if(task.storedKeys.begin(), task.storedKeys.end(), [&](const auto &s) {
                return s.start == region.start && s.end == region.end;
            });
            if (stored != task.storedKeys.end()) {
                vs::decodeKeyRuns(std::span<const uint8_t>(task.storedBytes.data() + stored->begin, stored->length),
                                  runs);
            } else {
                if (!pagemap.valid()) {
                    pagemap = task.openPagemap();
                    pagemapFailed = !pagemap.valid();
                }
                if (pagemap.valid()) {
                    _candidateKeys(pagemap.get(), region, runs, nullptr);
                }
            }
            // Pages no other target maps stay the mapping's own.
            _sharedPages.sharedPages(runs, sets);
            for (const vs::SharedPageIndex::SetPages &set : sets) {
                // Members map their copies at the same address unless one
                // moved its copy: then all place it where the lowest of
                // them has it, so that it stays one object.
                const uint64_t below = (set.firstPage - set.lowestPage) * _pageSize;
                const uint64_t start = below <= region.start ? region.start - below : region.start;
                shared.push_back({ids.idForFrameSet(set.set, start), start, set.presentPages, set.swappedPages});
            }
        }
        if (resolved && vs::isFileWindow(region, kind, _pageSize)) {
            objectPages = _sharedPages.objectPages(vs::objectDevice(region), region.inode, !region.shared,
                                                   region.offset / _pageSize, region.size() / _pageSize);
        }
        task.firstPart.push_back(static_cast<uint32_t>(task.parts.size()));
        for (const VSRegionInfo &part : vs::regionPartsFor(region, kind, task.tags[i], ids, _pageSize, shared, objectPages)) {
            vs::packRegionInfo(part, task.parts);
        }
    }
    task.firstPart.push_back(static_cast<uint32_t>(task.parts.size()));
    task.parts.shrink_to_fit();
    task.partsBuilt = true;
    if (!task.storedBytes.empty()) {
        _storedKeyBytes.fetch_sub(task.storedBytes.capacity());
    }
    std::vector<Task::StoredKeys>().swap(task.storedKeys);
    std::vector<uint8_t>().swap(task.storedBytes);
}

void VSLinuxPlatform::_candidateKeys(int pagemapFd, const SmapsRegion &region, std::vector<vs::KeyRun> &runs,
                                     bool *framesUnreadable) {
    const uint64_t zeroPage = _zeroFrame();
    _readPagemap(pagemapFd, region.start, region.size() / _pageSize, (region.rss + region.swap) / _pageSize,
                 [&](std::span<const uint64_t> entries, uint64_t first) {
                     const uint64_t firstPage = region.start / _pageSize + first;
                     for (size_t k = 0; k < entries.size(); ++k) {
                         const uint64_t entry = entries[k];
                         uint64_t key = 0;
                         if ((entry & kPagemapPresent) != 0) {
                             // Page cache of a file mapping, and pages only
                             // this process maps, are never in a set.
                             if ((entry & (kPagemapFileOrSharedAnon | kPagemapExclusive)) != 0) {
                                 continue;
                             }
                             key = entry & kPagemapPfnMask;
                             // Read but never written: the kernel's zero
                             // page, in no process's resident memory.
                             if (key == zeroPage && key != 0) {
                                 continue;
                             }
                         } else if ((entry & kPagemapSwapped) != 0 && (entry & kPagemapGuard) == 0) {
                             key = (entry & kPagemapPfnMask) == 0 ? 0 : (vs::kSwapKey | (entry & kPagemapPfnMask));
                         } else {
                             continue;
                         }
                         if (key == 0) {
                             // Frame numbers are hidden from this reader.
                             if (framesUnreadable != nullptr) {
                                 *framesUnreadable = true;
                             }
                             continue;
                         }
                         vs::appendKey(runs, key, firstPage + k);
                     }
                     return true;
                 });
}

namespace {

// The pagemap scan (Linux 6.7): which parts of a range hold pages at all.
struct PageRegion {
    uint64_t start, end, categories;
};
struct PagemapScan {
    uint64_t size, flags, start, end, walkEnd, vec, vecLength, maxPages, categoryInverted, categoryMask,
        categoryAnyOf, returnMask;
};
constexpr unsigned long kPagemapScan = _IOWR('f', 16, PagemapScan);
constexpr uint64_t kPageIsPresent = 1u << 3;
constexpr uint64_t kPageIsSwapped = 1u << 4;
// Without the scan a range is read whole; past this many pages (64 GiB of
// 4 KiB pages) that costs more than it can tell.
constexpr uint64_t kMaxUnscannedPages = uint64_t{1} << 24;

} // namespace

bool VSLinuxPlatform::_readPagemap(int pagemapFd, uint64_t address, uint64_t pages, uint64_t held,
                                   const std::function<bool(std::span<const uint64_t>, uint64_t)> &batch) {
    constexpr uint64_t kBatch = 16384; // 128 KiB of entries per read
    // One buffer per thread: fresh pages for every mapping cost more than
    // the reads.
    thread_local std::vector<uint64_t> entries;
    entries.resize(kBatch);
    // Reads [first, first + count) pages of the range; false to stop.
    auto readPages = [&](uint64_t first, uint64_t count, bool &failed) {
        for (uint64_t done = 0; done < count;) {
            const uint64_t want = std::min(count - done, kBatch);
            const off_t offset = static_cast<off_t>((address / _pageSize + first + done) * sizeof(uint64_t));
            const ssize_t n = ::pread(pagemapFd, entries.data(), want * sizeof(uint64_t), offset);
            if (n <= 0) {
                failed = true;
                return false;
            }
            const uint64_t got = static_cast<uint64_t>(n) / sizeof(uint64_t);
            if (!batch(std::span<const uint64_t>(entries.data(), got), first + done)) {
                return false;
            }
            done += got;
            if (got < want) {
                return false;
            }
        }
        return true;
    };

    bool failed = false;
    // Mostly held: the scan would only walk the same page tables once more.
    if (held * 2 >= pages) {
        readPages(0, pages, failed);
        return !failed;
    }
    // A sparse mapping (a sanitizer's shadow, a runtime's reservation) can
    // span terabytes of which a few pages are there: read only those.
    const uint64_t end = address + pages * _pageSize;
    thread_local std::vector<PageRegion> populated;
    populated.resize(512);
    for (uint64_t at = address; at < end;) {
        PagemapScan scan{};
        scan.size = sizeof scan;
        scan.start = at;
        scan.end = end;
        scan.vec = reinterpret_cast<uint64_t>(populated.data());
        scan.vecLength = populated.size();
        scan.categoryAnyOf = kPageIsPresent | kPageIsSwapped;
        scan.returnMask = kPageIsPresent | kPageIsSwapped;
        const int found = ::ioctl(pagemapFd, kPagemapScan, &scan);
        if (found < 0) {
            if (at != address) {
                return false; // the process changed under the scan
            }
            // An older kernel: the whole range, when that is bearable.
            if (pages > kMaxUnscannedPages) {
                return false;
            }
            readPages(0, pages, failed);
            return !failed;
        }
        for (int i = 0; i < found; ++i) {
            const uint64_t first = (populated[i].start - address) / _pageSize;
            if (!readPages(first, (populated[i].end - populated[i].start) / _pageSize, failed)) {
                return !failed;
            }
        }
        if (scan.walkEnd <= at || scan.walkEnd >= end) {
            break;
        }
        at = scan.walkEnd;
    }
    return true;
}

uint64_t VSLinuxPlatform::_zeroFrame() {
    // Learnt from this program's own memory: a page read before it is
    // written maps the zero page, and the kernel's page flags confirm it.
    // (pagemap shows the huge zero page as a file page, left out anyway.)
    std::call_once(_zeroFrameOnce, [this] {
        constexpr uint64_t kPageFlagZeroPage = 1ull << 24; // KPF_ZERO_PAGE
        UniqueFd pagemap(::open("/proc/self/pagemap", O_RDONLY | O_CLOEXEC));
        UniqueFd flags(::open("/proc/kpageflags", O_RDONLY | O_CLOEXEC));
        if (!pagemap.valid() || !flags.valid()) {
            return; // frames cannot be read either
        }
        void *page = ::mmap(nullptr, _pageSize, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (page == MAP_FAILED) {
            return;
        }
        (void)*static_cast<const volatile char *>(page);
        uint64_t entry = 0, pageFlags = 0;
        const auto at = static_cast<off_t>(reinterpret_cast<uintptr_t>(page) / _pageSize * sizeof entry);
        const bool present = ::pread(pagemap.get(), &entry, sizeof entry, at) == sizeof entry &&
                             (entry & kPagemapPresent) != 0 && (entry & kPagemapPfnMask) != 0;
        ::munmap(page, _pageSize);
        const uint64_t frame = entry & kPagemapPfnMask;
        if (present && ::pread(flags.get(), &pageFlags, sizeof pageFlags, static_cast<off_t>(frame * sizeof pageFlags)) ==
                           sizeof pageFlags && (pageFlags & kPageFlagZeroPage) != 0) {
            _zeroPage = frame;
        }
    });
    return _zeroPage;
}

bool VSLinuxPlatform::prepare_task_walk(VSTaskHandle handle) {
    auto task = _task(handle);
    if (!task) {
        return false;
    }
    std::lock_guard<std::mutex> lock(task->mutex);
    // Once the run has resolved its sharing, a late target shares nothing.
    if (_ensureParsed(*task) != 0 || task->prepared || _sharedPagesResolved.load()) {
        return task->prepared;
    }
    UniqueFd pagemap;
    thread_local std::vector<vs::KeyRun> runs;
    thread_local std::vector<vs::KeyRun> allRuns;
    allRuns.clear();
    bool framesUnreadable = false;
    bool any = false;
    for (size_t i = 0; i < task->regions.size(); ++i) {
        const SmapsRegion &region = task->regions[i];
        const vs::MappingKind kind = task->kinds[i];
        const bool anonymous = vs::mayShareAnonymousPages(region, kind);
        const bool window = vs::isFileWindow(region, kind, _pageSize);
        if (!anonymous && !window) {
            continue;
        }
        if (!pagemap.valid()) {
            pagemap = task->openPagemap();
            if (!pagemap.valid()) {
                // The walk reports the process; nothing to share from it.
                return false;
            }
        }
        if (anonymous) {
            any = true;
            runs.clear();
            _candidateKeys(pagemap.get(), region, runs, &framesUnreadable);
            allRuns.insert(allRuns.end(), runs.begin(), runs.end());
            if (!runs.empty()) {
                _sharedPages.notePlace(runs.front().first, runs.front().page);
            }
            const size_t before = task->storedBytes.size();
            vs::encodeKeyRuns(runs, task->storedBytes);
            task->storedKeys.push_back({region.start, region.end, before, task->storedBytes.size() - before});
        }
        if (window) {
            any = _addWindow(pagemap.get(), region, kind) || any;
        }
    }
    // All at once: a page the target maps twice is then still one member.
    _sharedPages.addPages(task->pid, allRuns);
    allRuns.clear();
    if (framesUnreadable) {
        _sharedFramesUnreadable.store(true);
    }
    // Kept within a budget; beyond it the walk reads the frames again.
    task->storedBytes.shrink_to_fit();
    if (_storedKeyBytes.fetch_add(task->storedBytes.capacity()) + task->storedBytes.capacity() > kStoredKeyBudget) {
        _storedKeyBytes.fetch_sub(task->storedBytes.capacity());
        std::vector<Task::StoredKeys>().swap(task->storedKeys);
        std::vector<uint8_t>().swap(task->storedBytes);
    }
    task->prepared = true;
    task->partsBuilt = false;
    if (any) {
        task->packed = vs::packSmapsRegions(task->regions);
        std::vector<SmapsRegion>().swap(task->regions);
    }
    return any;
}

bool VSLinuxPlatform::_addWindow(int pagemapFd, const SmapsRegion &region, vs::MappingKind kind) {
    // Which file pages the mapping holds, and which of them are dirty
    // (shmem pages are all dirty; page cache says per frame). A private
    // mapping's own copies are no file pages.
    vs::SharedPageIndex::Window pages;
    pages.device = vs::objectDevice(region);
    pages.inode = region.inode;
    pages.privateMapping = !region.shared;
    pages.firstPage = region.offset / _pageSize;
    pages.pageCount = region.size() / _pageSize;
    const uint64_t filePages = vs::filePages(region, _pageSize);
    pages.dirtyCount = vs::fileDirtyPages(region, _pageSize);
    const bool shmem = kind == vs::MappingKind::SharedMemory;
    const bool whole = filePages == pages.pageCount;
    if (filePages == 0) {
        pages.present.assign(1, 0);
    } else if (!whole) {
        pages.present.assign((pages.pageCount + 63) / 64, 0);
        thread_local std::vector<std::pair<uint64_t, uint64_t>> frames; // frame, page of the mapping
        frames.clear();
        _readPagemap(pagemapFd, region.start, pages.pageCount, region.rss / _pageSize,
                     [&](std::span<const uint64_t> entries, uint64_t first) {
                         for (size_t k = 0; k < entries.size(); ++k) {
                             if ((entries[k] & kPagemapPresent) != 0 &&
                                 (region.shared || (entries[k] & kPagemapFileOrSharedAnon) != 0)) {
                                 pages.present[(first + k) / 64] |= 1ull << ((first + k) % 64);
                                 frames.emplace_back(entries[k] & kPagemapPfnMask, first + k);
                             }
                         }
                         return true;
                     });
        if (!shmem && pages.dirtyCount == 0) {
            pages.dirty.assign(pages.present.size(), 0); // smaps says none is
        } else if (!shmem && !frames.empty() && frames.front().first != 0) {
            pages.dirty.assign(pages.present.size(), 0);
            _forEachDirtyFrame(frames, [&](uint64_t page) { pages.dirty[page / 64] |= 1ull << (page % 64); });
        }
    }
    if (shmem) {
        pages.dirty = pages.present.empty() ? std::vector<uint64_t>((pages.pageCount + 63) / 64, ~0ull) : pages.present;
    }
    _sharedPages.addWindow(pages);
    // A mapping holding its whole range is exact on its own: its walk need
    // not wait for the others' pages.
    return !whole;
}

void VSLinuxPlatform::_forEachDirtyFrame(std::vector<std::pair<uint64_t, uint64_t>> &frames,
                                         const std::function<void(uint64_t)> &dirty) {
    std::call_once(_kpageflagsOnce, [this] {
        _kpageflagsFd = ::open("/proc/kpageflags", O_RDONLY | O_CLOEXEC);
    });
    if (_kpageflagsFd < 0 || frames.empty()) {
        return;
    }
    // Read in runs of nearby frames: pages written together sit together.
    std::sort(frames.begin(), frames.end());
    constexpr uint64_t kMaxRun = 512;
    thread_local std::vector<uint64_t> flags;
    flags.resize(kMaxRun);
    size_t i = 0;
    while (i < frames.size()) {
        const uint64_t runStart = frames[i].first;
        size_t j = i;
        while (j + 1 < frames.size() && frames[j + 1].first - runStart < kMaxRun) {
            ++j;
        }
        const uint64_t runLength = frames[j].first - runStart + 1;
        const ssize_t n = ::pread(_kpageflagsFd, flags.data(), runLength * sizeof(uint64_t),
                                  static_cast<off_t>(runStart * sizeof(uint64_t)));
        if (n > 0) {
            const uint64_t got = static_cast<uint64_t>(n) / sizeof(uint64_t);
            for (size_t k = i; k <= j; ++k) {
                const uint64_t at = frames[k].first - runStart;
                if (at < got && (flags[at] & kPageFlagDirty) != 0) {
                    dirty(frames[k].second);
                }
            }
        }
        i = j + 1;
    }
}

bool VSLinuxPlatform::resolve_shared_pages() {
    _sharedPages.freeze();
    _sharedPagesResolved.store(true);
    return !_sharedFramesUnreadable.load();
}

void VSLinuxPlatform::_releaseParse(Task &task) {
    std::vector<SmapsRegion>().swap(task.regions);
    task.packed = vs::PackedSmapsRegions{};
    std::vector<vs::MappingKind>().swap(task.kinds);
    std::vector<uint32_t>().swap(task.tags);
    std::vector<uint8_t>().swap(task.parts);
    std::vector<uint32_t>().swap(task.firstPart);
    task.partsBuilt = false;
    task.parsed = false;
    task.parseCode = 0;
}

VSReturnCode VSLinuxPlatform::_ensureParsed(Task &task) {
    if (!task.parsed) {
        task.parseCode = _parse(task);
        task.parsed = true;
    }
    if (task.packed.count != 0) {
        vs::unpackSmapsRegions(task.packed, task.regions);
        task.packed = vs::PackedSmapsRegions{};
    }
    return task.parseCode;
}

VSReturnCode VSLinuxPlatform::region_recurse(VSTaskHandle handle, uint64_t &address,
                                             uint64_t &size, uint32_t &depth,
                                             VSRegionInfo &info, uint32_t &infoCount) {
    auto task = _task(handle);
    if (!task) {
        return vs::kReturnDeadPort;
    }
    if (infoCount < vs::kRegionInfoCount) {
        return EINVAL;
    }
    std::lock_guard<std::mutex> lock(task->mutex);
    const VSReturnCode code = _ensureParsed(*task);
    if (code != 0) {
        return code;
    }
    const size_t i = regionAtOrAbove(task->regions, address, task->walkHint);
    if (i >= task->regions.size()) {
        // The walk has passed the last region and is done with the parse:
        // a run over every process then holds one parse per thread at a
        // time, not one per target. Asked again, the handle parses anew.
        _releaseParse(*task);
        return vs::kReturnNoMoreRegions;
    }
    _buildParts(*task);
    address = task->regions[i].start;
    size = task->regions[i].size();
    depth = 0;
    size_t at = task->firstPart[i];
    info = vs::unpackRegionInfo(task->parts, at);
    infoCount = vs::kRegionInfoCount;
    return 0;
}

VSReturnCode VSLinuxPlatform::region_parts(VSTaskHandle handle, uint64_t address,
                                           std::vector<VSRegionInfo> &parts) {
    parts.clear();
    auto task = _task(handle);
    if (!task) {
        return vs::kReturnDeadPort;
    }
    std::lock_guard<std::mutex> lock(task->mutex);
    const VSReturnCode code = _ensureParsed(*task);
    if (code != 0) {
        return code;
    }
    const size_t i = regionAtOrAbove(task->regions, address, task->walkHint);
    if (i >= task->regions.size() || task->regions[i].start > address) {
        return vs::kReturnNoMoreRegions;
    }
    _buildParts(*task);
    for (size_t at = task->firstPart[i]; at < task->firstPart[i + 1];) {
        parts.push_back(vs::unpackRegionInfo(task->parts, at));
    }
    return 0;
}

VSReturnCode VSLinuxPlatform::region_info(VSTaskHandle handle, uint64_t &address, uint64_t &size,
                                          int32_t flavor, VSRegionBasicInfo &info,
                                          uint32_t &infoCount, uint32_t &objectName) {
    objectName = 0;
    auto task = _task(handle);
    if (!task) {
        return vs::kReturnDeadPort;
    }
    if (flavor != vs::kRegionBasicInfoFlavor || infoCount < vs::kRegionBasicInfoCount) {
        return EINVAL;
    }
    std::lock_guard<std::mutex> lock(task->mutex);
    const VSReturnCode code = _ensureParsed(*task);
    if (code != 0) {
        return code;
    }
    const size_t i = regionAtOrAbove(task->regions, address, task->walkHint);
    if (i >= task->regions.size()) {
        return vs::kReturnNoMoreRegions;
    }
    address = task->regions[i].start;
    size = task->regions[i].size();
    info = vs::basicInfoFor(task->regions[i], task->kinds[i], _pageSize);
    infoCount = vs::kRegionBasicInfoCount;
    return 0;
}

VSReturnCode VSLinuxPlatform::page_range_query(VSTaskHandle handle, uint64_t address,
                                               uint64_t length, std::span<int32_t> dispositions,
                                               uint64_t &count) {
    count = 0;
    auto task = _task(handle);
    if (!task) {
        return vs::kReturnInvalidArgument;
    }
    const uint64_t first = address & ~(_pageSize - 1);
    const uint64_t last = (address + length + _pageSize - 1) & ~(_pageSize - 1);
    const uint64_t pages = std::min<uint64_t>((last - first) / _pageSize, dispositions.size());
    if (pages == 0) {
        return 0;
    }

    // Which pages belong to file mappings decides "external": a present
    // page of the shmem family is as undroppable as anonymous memory.
    std::vector<std::pair<uint64_t, uint64_t>> fileRanges;
    bool haveRegions = false;
    {
        std::lock_guard<std::mutex> lock(task->mutex);
        if (_ensureParsed(*task) == 0) {
            haveRegions = true;
            for (size_t i = 0; i < task->regions.size(); ++i) {
                if (task->kinds[i] == vs::MappingKind::File) {
                    fileRanges.emplace_back(task->regions[i].start, task->regions[i].end);
                }
            }
        }
    }
    const ProcessDir dir = task->openDir();
    if (dir.get() < 0) {
        return dir.error() == ESRCH ? vs::kReturnInvalidArgument : dir.error();
    }
    const int pagemap = ::openat(dir.get(), "pagemap", O_RDONLY | O_CLOEXEC);
    if (pagemap < 0) {
        return (errno == ESRCH || errno == ENOENT) ? vs::kReturnInvalidArgument : errno;
    }
    UniqueFd pagemapFd(pagemap);

    constexpr uint64_t kBatch = 4096;

    std::vector<uint64_t> entries(std::min(pages, kBatch));
    std::vector<std::pair<uint64_t, uint64_t>> presentPfns; // (pfn, page index)
    for (uint64_t done = 0; done < pages;) {
        const uint64_t batch = std::min(pages - done, kBatch);
        const off_t offset = static_cast<off_t>((first / _pageSize + done) * sizeof(uint64_t));
        const ssize_t n = ::pread(pagemapFd.get(), entries.data(), batch * sizeof(uint64_t), offset);
        if (n < 0) {
            return (errno == ESRCH || errno == ENOENT) ? vs::kReturnInvalidArgument : errno;
        }
        if (n == 0) {
            // No address space any more: the process is exiting.
            return vs::kReturnInvalidArgument;
        }
        const uint64_t got = static_cast<uint64_t>(n) / sizeof(uint64_t);
        size_t fileIndex = 0;
        for (uint64_t k = 0; k < got; ++k) {
            const uint64_t index = done + k;
            const uint64_t entry = entries[k];
            const uint64_t page = first + index * _pageSize;
            int32_t word = 0;
            if ((entry & kPagemapGuard) != 0) {
                dispositions[index] = 0; // a guard marker holds no page
                continue;
            }
            if ((entry & kPagemapPresent) != 0) {
                word |= vs::kPageDispositionPresent;
                if ((entry & kPagemapPfnMask) != 0) {
                    presentPfns.emplace_back(entry & kPagemapPfnMask, index);
                }
            } else if ((entry & kPagemapSwapped) != 0) {
                word |= vs::kPageDispositionPagedOut;
            }
            if ((entry & kPagemapFileOrSharedAnon) != 0) {
                bool external = !haveRegions;
                while (fileIndex < fileRanges.size() && fileRanges[fileIndex].second <= page) {
                    ++fileIndex;
                }
                if (fileIndex < fileRanges.size() && fileRanges[fileIndex].first <= page) {
                    external = true;
                }
                if (external) {
                    word |= vs::kPageDispositionExternal;
                }
            }
            dispositions[index] = word;
        }
        done += got;
        if (got < batch) {
            // Past the end of the user address space: nothing is mapped.
            for (uint64_t index = done; index < pages; ++index) {
                dispositions[index] = 0;
            }
            break;
        }
    }

    _forEachDirtyFrame(presentPfns, [&](uint64_t index) { dispositions[index] |= vs::kPageDispositionDirty; });
    count = pages;
    return 0;
}

VSReturnCode VSLinuxPlatform::purgeable_control(VSTaskHandle, uint64_t, int32_t, int32_t &state) {
    // There is no purgeable memory on Linux.
    state = VSPurgeableDeny;
    return ENOTSUP;
}

VSReturnCode VSLinuxPlatform::task_memory_info(VSTaskHandle handle, VSTaskKernelMemoryInfo &info,
                                               uint32_t &count) {
    info = VSTaskKernelMemoryInfo{};
    auto task = _task(handle);
    if (!task) {
        return vs::kReturnDeadPort;
    }
    if (count < vs::kTaskKernelMemoryInfoCount) {
        return EINVAL;
    }
    const ProcessDir dir = task->openDir();
    std::string_view status;
    const int error = dir.get() < 0 ? dir.error() : vs::readOnePieceFileAt(dir.get(), "status", status);
    if (error != 0) {
        return (error == ESRCH || error == ENOENT) ? vs::kReturnDeadPort : error;
    }
    Task::StatusFigures figures(status);
    if (!figures.pte || !figures.threads) {
        return vs::kReturnDeadPort;
    }
    // Page tables and the kernel stacks of the threads are the memory the
    // kernel keeps for this process alone.
    info.privateAllocated = *figures.pte + *figures.threads * kKernelStackSize;
    {
        std::lock_guard<std::mutex> lock(task->mutex);
        task->status.emplace(std::move(figures));
    }
    count = vs::kTaskKernelMemoryInfoCount;
    return 0;
}

std::vector<VSSymbolicatorImage> VSLinuxPlatform::symbolicator(VSTaskHandle handle, uint32_t) {
    std::vector<VSSymbolicatorImage> result;
    auto task = _task(handle);
    if (!task) {
        return result;
    }
    std::lock_guard<std::mutex> lock(task->mutex);
    if (_ensureParsed(*task) != 0) {
        return result;
    }
    const ProcessDir dir = task->openDir();
    if (dir.get() < 0) {
        return result;
    }
    MappedFileContext context{dir.get(), task->regions, _pageSize, _openableDevices(), false, {}, {}};
    const auto images = vs::processImages(task->regions, _pageSize, vs::ElfCache::shared(),
                                          readMappedFile, &context);
    result.reserve(images.size());
    for (const vs::ProcessImage &image : images) {
        VSSymbolicatorImage out;
        out.path = image.path;
        for (const vs::ImageSegment &segment : image.segments) {
            out.segments.push_back(VSSymbolicatorSegment{segment.name, segment.start, segment.size});
        }
        result.push_back(std::move(out));
    }
    return result;
}

VSReturnCode VSLinuxPlatform::task_regions(VSTaskHandle handle, std::vector<SmapsRegion> &regions) {
    regions.clear();
    auto task = _task(handle);
    if (!task) {
        return vs::kReturnDeadPort;
    }
    std::lock_guard<std::mutex> lock(task->mutex);
    const VSReturnCode code = _ensureParsed(*task);
    if (code == 0) {
        regions = task->regions;
    }
    return code;
}

int32_t VSLinuxPlatform::task_pid(VSTaskHandle handle) {
    auto task = _task(handle);
    return task ? task->pid : -1;
}

// ---- codes and system facts ------------------------------------------------------------

uint64_t VSLinuxPlatform::kernel_page_size() {
    return _pageSize;
}

std::string VSLinuxPlatform::error_text(VSReturnCode code) {
    switch (code) {
    case vs::kReturnSuccess:
        return "success";
    case vs::kReturnNoMoreRegions:
        return "no region at or above the address";
    case vs::kReturnInvalidArgument:
        return "invalid argument";
    case vs::kReturnDeadPort:
        return "the process has gone away";
    default:
        break;
    }
    if (code > 0) {
        char buffer[256];
        // The GNU strerror_r returns the text, which may not be the buffer.
        const char *text = ::strerror_r(code, buffer, sizeof buffer);
        return text;
    }
    return "error " + std::to_string(code);
}

void VSLinuxPlatform::report_error_code(std::string_view label, VSReturnCode code) {
    const std::string text = error_text(code);
    std::fprintf(stderr, "%.*s: %s (%d)\n", static_cast<int>(label.size()), label.data(),
                 text.c_str(), code);
}

std::optional<std::string> VSLinuxPlatform::dynamic_tag_name(uint32_t tag) {
    if (auto name = vs::dynamicTagName(tag)) {
        return name;
    }
    if (const char *fixed = vs::userTagTableName(tag)) {
        return std::string(fixed);
    }
    return std::nullopt;
}

// ---- this program's own task ---------------------------------------------------------------

int32_t VSLinuxPlatform::sysctl_by_name_read(std::string_view name, int32_t &value) {
    // Every target asks for the same setting, which this kernel may not
    // have: one failed lookup answers for the run.
    std::string key(name);
    {
        std::lock_guard<std::mutex> lock(_missingSettingsMutex);
        if (_missingSettings.count(key) != 0) {
            return ENOENT;
        }
    }
    std::string path = "/proc/sys/";
    for (char c : name) {
        path.push_back(c == '.' ? '/' : c);
    }
    std::string_view text;
    const int error = vs::readFileAt(AT_FDCWD, path.c_str(), text);
    if (error == ENOENT) {
        std::lock_guard<std::mutex> lock(_missingSettingsMutex);
        _missingSettings.insert(std::move(key));
    }
    if (error != 0) {
        return error;
    }
    char *end = nullptr;
    const std::string copy(text);
    const long parsed = std::strtol(copy.c_str(), &end, 10);
    if (end == copy.c_str()) {
        return EINVAL;
    }
    value = static_cast<int32_t>(parsed);
    return 0;
}

int32_t VSLinuxPlatform::sysctl_by_name_write(std::string_view name, int32_t value) {
    std::string path = "/proc/sys/";
    for (char c : name) {
        path.push_back(c == '.' ? '/' : c);
    }
    const int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    const std::string text = std::to_string(value) + "\n";
    const ssize_t n = ::write(fd, text.data(), text.size());
    const int error = n < 0 ? errno : 0;
    ::close(fd);
    return error;
}

int32_t VSLinuxPlatform::own_pid() {
    return static_cast<int32_t>(::getpid());
}

uint32_t VSLinuxPlatform::effective_user_id() {
    return static_cast<uint32_t>(::geteuid());
}
