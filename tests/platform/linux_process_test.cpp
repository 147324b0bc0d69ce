// The Linux layer against real child processes whose memory the test
// arranges (tests/helpers/vs_memchild.cpp): every figure is compared page
// for page with what the child was told to do.

#include "model/memory_region.h"
#include "targets/platform/linux/linux_platform.h"
#include "targets/platform/linux/object_ids.h"
#include "targets/platform/linux/smaps_parser.h"
#include "tests/platform/linux_child_process.h"

#include <algorithm>
#include <cstring>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <string>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace {

using vs_test::ChildProcess;

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

struct WalkedRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    VSRegionInfo info;
};

// The whole walk, as the region walk does it: from 0 up, each answer's end
// is the next question.
VSReturnCode walk(VSLinuxPlatform &platform, VSTaskHandle task, std::vector<WalkedRegion> &out) {
    uint64_t address = 0;
    for (;;) {
        WalkedRegion r;
        uint64_t size = 0;
        uint32_t depth = vs::kUnlimitedDepth;
        uint32_t count = vs::kRegionInfoCount;
        const VSReturnCode code = platform.region_recurse(task, address, size, depth, r.info, count);
        if (code != 0) {
            return code;
        }
        EXPECT_EQ(count, vs::kRegionInfoCount);
        EXPECT_EQ(depth, 0u);
        r.start = address;
        r.size = size;
        out.push_back(r);
        address += size;
    }
}

const WalkedRegion *containing(const std::vector<WalkedRegion> &regions, uint64_t address) {
    for (const WalkedRegion &r : regions) {
        if (r.start <= address && address < r.start + r.size) {
            return &r;
        }
    }
    return nullptr;
}

// A file of `pages` pages on a disk file system, written back so that its
// page cache is clean.
std::string makeCleanFile(const char *name, size_t pages) {
    const std::string path = std::string(VESTAGE_TEST_BIN_DIR) + "/" + name;
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    EXPECT_GE(fd, 0) << path;
    std::string page(kPage, 'v');
    for (size_t i = 0; i < pages; ++i) {
        EXPECT_EQ(write(fd, page.data(), page.size()), static_cast<ssize_t>(page.size()));
    }
    fsync(fd);
    close(fd);
    return path;
}

// The name derivation's scan over an argument area: skip the count up to
// its first zero byte, skip the zeros, take the path's last component.
std::string nameFromArgumentArea(std::string area) {
    if (area.empty()) {
        return {};
    }
    area.back() = '\0';
    size_t i = area.find('\0');
    while (i < area.size() && area[i] == '\0') {
        ++i;
    }
    if (i >= area.size()) {
        return {};
    }
    const std::string path(area.c_str() + i);
    return path.substr(path.rfind('/') + 1);
}

class LinuxProcessTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the Linux layer tests read other processes and need root";
        }
    }
    VSLinuxPlatform platform;
};

TEST_F(LinuxProcessTest, ArrangedMemoryPageForPage) {
    const std::string file = makeCleanFile("vs_linux_test_file", 3);
    const std::string shmName = "vs_linux_test_" + std::to_string(getpid());
    ChildProcess child({"anon:a:8:5", "anon:u:4:0", "file:f:" + file, "shared:s:4", "shm:p:" + shmName + ":2",
                        "mlock:m:3", "free:fr:8:3", "exec:e:2", "none:n:2", "thread:t"});
    ASSERT_TRUE(child.ready());
    VSTaskHandle task = 0;
    ASSERT_EQ(platform.task_handle_for_pid(child.pid(), task), 0);
    ASSERT_NE(task, 0u);

    std::vector<WalkedRegion> regions;
    ASSERT_EQ(walk(platform, task, regions), vs::kReturnNoMoreRegions);
    ASSERT_FALSE(regions.empty());
    for (size_t i = 1; i < regions.size(); ++i) {
        EXPECT_LE(regions[i - 1].start + regions[i - 1].size, regions[i].start) << i;
    }

    struct Expect {
        const char *label;
        uint32_t resident, dirtied, reusable, wired;
        uint8_t shareMode;
        uint32_t tag;
        uint8_t external;
        std::string path; // of pid_region_filename
    };
    const Expect expected[] = {
        {"a", 5, 5, 0, 0, vs::kShareModePrivate, 0, 0, ""},
        {"u", 0, 0, 0, 0, vs::kShareModeEmpty, 0, 0, ""},
        {"f", 3, 0, 0, 0, vs::kShareModeCopyOnWrite, 0, 1, file},
        // Shared memory has no pager, yet it is a mapped file with a path.
        {"s", 4, 4, 0, 0, vs::kShareModeShared, vs::kTagDevZero, 0, "/dev/zero (deleted)"},
        {"p", 2, 2, 0, 0, vs::kShareModeShared, vs::kTagPosixSharedMemory, 0, "/dev/shm/" + shmName},
        {"m", 3, 3, 0, 3, vs::kShareModePrivate, 0, 0, ""},
        {"fr", 8, 5, 3, 0, vs::kShareModePrivate, 0, 0, ""},
        {"e", 2, 2, 0, 0, vs::kShareModePrivate, vs::kTagJitCode, 0, ""},
        {"n", 0, 0, 0, 0, vs::kShareModeEmpty, vs::kTagGuard, 0, ""},
    };
    for (const Expect &e : expected) {
        const uint64_t start = child.hex(e.label, "start");
        const WalkedRegion *r = containing(regions, start);
        ASSERT_NE(r, nullptr) << e.label;
        EXPECT_EQ(r->start, start) << e.label;
        EXPECT_EQ(r->size, child.hex(e.label, "size")) << e.label;
        EXPECT_EQ(r->info.residentPages, e.resident) << e.label;
        EXPECT_EQ(r->info.dirtiedPages, e.dirtied) << e.label;
        EXPECT_EQ(r->info.reusablePages, e.reusable) << e.label;
        EXPECT_EQ(r->info.userWiredCount, e.wired) << e.label;
        EXPECT_EQ(r->info.shareMode, e.shareMode) << e.label;
        EXPECT_EQ(r->info.userTag, e.tag) << e.label;
        EXPECT_EQ(r->info.externalPager, e.external) << e.label;
        EXPECT_EQ(r->info.swappedOutPages, 0u) << e.label;
        EXPECT_NE(r->info.objectId, 0u) << e.label;
        char path[vs::kRegionFilenameBufferSize];
        const int32_t length = platform.pid_region_filename(child.pid(), start, path);
        EXPECT_EQ(std::string(path, static_cast<size_t>(std::max(length, 0))), e.path) << e.label;
    }

    // The file's object is the same for every process that maps it.
    struct stat st {};
    ASSERT_EQ(stat(file.c_str(), &st), 0);
    const uint64_t device = (uint64_t{major(st.st_dev)} << 32) | minor(st.st_dev);
    EXPECT_EQ(containing(regions, child.hex("f", "start"))->info.objectId,
              vs::ObjectIdTable::shared().idForFile(device, st.st_ino));

    // The blocked thread's stack is "stack"; the no-access page below it
    // that the thread library leaves as a guard is "guard".
    const WalkedRegion *stack = containing(regions, child.hex("t", "local"));
    ASSERT_NE(stack, nullptr);
    EXPECT_EQ(stack->info.userTag, vs::kTagStack);
    const WalkedRegion *guard = containing(regions, stack->start - 1);
    ASSERT_NE(guard, nullptr);
    EXPECT_EQ(guard->info.userTag, vs::kTagGuard);
    EXPECT_EQ(guard->info.protection, 0);

    // region_info answers from the same parse.
    for (const char *label : {"a", "f", "s"}) {
        uint64_t address = child.hex(label, "start") - 1;
        uint64_t size = 0;
        VSRegionBasicInfo basic;
        uint32_t count = vs::kRegionBasicInfoCount;
        uint32_t objectName = 99;
        ASSERT_EQ(platform.region_info(task, address, size, vs::kRegionBasicInfoFlavor, basic, count, objectName), 0);
        const WalkedRegion *r = containing(regions, address);
        ASSERT_NE(r, nullptr);
        EXPECT_EQ(address, r->start) << label;
        EXPECT_EQ(size, r->size) << label;
        EXPECT_EQ(basic.protection, r->info.protection) << label;
        EXPECT_EQ(basic.offset, r->info.offset) << label;
        EXPECT_EQ(objectName, 0u);
    }
    EXPECT_EQ(platform.release_task_handle(task), 0);
    EXPECT_NE(platform.release_task_handle(task), 0) << "a handle is released once";
    child.end();
    unlink(("/dev/shm/" + shmName).c_str());
}

TEST_F(LinuxProcessTest, SharedMemoryIsOneObjectAcrossProcesses) {
    const std::string file = makeCleanFile("vs_linux_test_shared_file", 2);
    ChildProcess child({"shared:s:4", "file:f:" + file, "anon:a:2:2", "fork:g"});
    ASSERT_TRUE(child.ready());
    const int grandchild = static_cast<int>(child.decimal("g", "pid"));
    ASSERT_GT(grandchild, 0);

    VSTaskHandle parentTask = 0;
    VSTaskHandle childTask = 0;
    ASSERT_EQ(platform.task_handle_for_pid(child.pid(), parentTask), 0);
    ASSERT_EQ(platform.task_handle_for_pid(grandchild, childTask), 0);
    std::vector<WalkedRegion> parentRegions;
    std::vector<WalkedRegion> childRegions;
    ASSERT_EQ(walk(platform, parentTask, parentRegions), vs::kReturnNoMoreRegions);
    ASSERT_EQ(walk(platform, childTask, childRegions), vs::kReturnNoMoreRegions);

    const WalkedRegion *s1 = containing(parentRegions, child.hex("s", "start"));
    const WalkedRegion *s2 = containing(childRegions, child.hex("s", "start"));
    ASSERT_TRUE(s1 && s2);
    EXPECT_EQ(s1->info.objectId, s2->info.objectId);
    for (const WalkedRegion *s : {s1, s2}) {
        EXPECT_EQ(s->info.shareMode, vs::kShareModeShared);
        EXPECT_EQ(s->info.dirtiedPages, 4u);
        EXPECT_EQ(s->info.residentPages, 4u);
        EXPECT_EQ(s->info.inheritance, vs::kInheritShare);
    }
    const WalkedRegion *f1 = containing(parentRegions, child.hex("f", "start"));
    const WalkedRegion *f2 = containing(childRegions, child.hex("f", "start"));
    ASSERT_TRUE(f1 && f2);
    EXPECT_EQ(f1->info.objectId, f2->info.objectId);

    // Private anonymous memory is an object of each process, even where
    // fork left its pages shared copy-on-write.
    const WalkedRegion *a1 = containing(parentRegions, child.hex("a", "start"));
    const WalkedRegion *a2 = containing(childRegions, child.hex("a", "start"));
    ASSERT_TRUE(a1 && a2);
    EXPECT_NE(a1->info.objectId, a2->info.objectId);
    EXPECT_EQ(a1->info.shareMode, vs::kShareModeCopyOnWrite);
    EXPECT_EQ(a2->info.shareMode, vs::kShareModeCopyOnWrite);
    child.end();
}

TEST_F(LinuxProcessTest, PageDispositions) {
    const std::string file = makeCleanFile("vs_linux_test_pages_file", 3);
    ChildProcess child({"anon:a:8:5", "file:f:" + file, "shared:s:2"});
    ASSERT_TRUE(child.ready());
    VSTaskHandle task = 0;
    ASSERT_EQ(platform.task_handle_for_pid(child.pid(), task), 0);

    struct Case {
        const char *label;
        uint64_t pages;
        std::vector<int32_t> expected; // masked to present | external | paged out
    };
    constexpr int32_t P = vs::kPageDispositionPresent;
    constexpr int32_t X = vs::kPageDispositionExternal;
    const Case cases[] = {
        {"a", 8, {P, P, P, P, P, 0, 0, 0}},
        {"f", 3, {P | X, P | X, P | X}},
        {"s", 2, {P, P}}, // shared anonymous pages are not file-backed
    };
    constexpr int32_t kMask = P | X | vs::kPageDispositionPagedOut;
    for (const Case &c : cases) {
        std::vector<int32_t> words(c.pages + 4, -1);
        uint64_t count = 0;
        // An unaligned start and length still cover whole pages.
        const uint64_t start = child.hex(c.label, "start");
        ASSERT_EQ(platform.page_range_query(task, start + 10, c.pages * kPage - 10,
                                            std::span<int32_t>(words.data(), c.pages), count),
                  0)
            << c.label;
        EXPECT_EQ(count, c.pages) << c.label;
        for (uint64_t i = 0; i < c.pages; ++i) {
            EXPECT_EQ(words[i] & kMask, c.expected[i]) << c.label << " page " << i;
        }
        EXPECT_EQ(words[c.pages], -1) << "nothing written past the room given";
    }
    // The file's pages were written back, so none is dirty.
    std::vector<int32_t> words(3);
    uint64_t count = 0;
    ASSERT_EQ(platform.page_range_query(task, child.hex("f", "start"), 3 * kPage, words, count), 0);
    for (int32_t w : words) {
        EXPECT_EQ(w & vs::kPageDispositionDirty, 0);
    }
    child.end();
}

TEST_F(LinuxProcessTest, SharedLibrarySegments) {
    ChildProcess child({"libc:l"});
    ASSERT_TRUE(child.ready());
    const std::string libcPath = child.text("l", "path");
    const uint64_t bias = child.hex("l", "bias");
    ASSERT_FALSE(libcPath.empty());
    VSTaskHandle task = 0;
    ASSERT_EQ(platform.task_handle_for_pid(child.pid(), task), 0);

    const auto images = platform.symbolicator(task, vs::kSymbolicatorImagesOnly);
    const auto libc = std::find_if(images.begin(), images.end(),
                                   [&](const VSSymbolicatorImage &image) { return image.path == libcPath; });
    ASSERT_NE(libc, images.end()) << libcPath;

    // Every PT_LOAD the loader used shows as a segment at bias + vaddr,
    // named by its protection.
    const auto relro = child.text("l", "relro");
    uint64_t relroStart = 0;
    if (!relro.empty()) {
        relroStart = std::strtoull(relro.c_str(), nullptr, 16);
    }
    size_t writable = 0;
    for (const std::string &load : child.texts("l", "load")) {
        char *end = nullptr;
        const uint64_t vaddr = std::strtoull(load.c_str(), &end, 16);
        const uint64_t memsz = std::strtoull(end + 1, &end, 16);
        const unsigned flags = static_cast<unsigned>(std::strtoul(end + 1, nullptr, 16));
        const bool isWritable = (flags & 2) != 0;
        const char *name = !isWritable ? "__TEXT" : (relroStart == vaddr ? "__DATA_CONST" : "__DATA");
        writable += isWritable ? 1 : 0;
        const auto segment = std::find_if(libc->segments.begin(), libc->segments.end(),
                                          [&](const VSSymbolicatorSegment &s) { return s.start == bias + vaddr; });
        ASSERT_NE(segment, libc->segments.end()) << load;
        EXPECT_EQ(segment->name, name) << load;
        if (!isWritable) {
            EXPECT_EQ(segment->length, memsz) << load;
        }
        // The segment's last byte is the load's last byte, split or not.
        const auto last = std::find_if(libc->segments.begin(), libc->segments.end(), [&](const VSSymbolicatorSegment &s) {
            return s.start + s.length == bias + vaddr + memsz;
        });
        EXPECT_NE(last, libc->segments.end()) << load;
    }
    EXPECT_EQ(writable, 1u);
    const bool hasData = std::any_of(libc->segments.begin(), libc->segments.end(),
                                     [](const VSSymbolicatorSegment &s) { return s.name == "__DATA"; });
    EXPECT_TRUE(hasData);

    // The helper program itself is an image too.
    const std::string helper = std::string(VESTAGE_TEST_BIN_DIR) + "/vs_memchild";
    char resolved[PATH_MAX];
    ASSERT_NE(realpath(helper.c_str(), resolved), nullptr);
    EXPECT_TRUE(std::any_of(images.begin(), images.end(),
                            [&](const VSSymbolicatorImage &image) { return image.path == resolved; }));
    child.end();
}

TEST_F(LinuxProcessTest, ProcessThatGoesAwayWhileRead) {
    struct Case {
        const char *what;
        bool parseBefore; // walk once while the child still lives
        bool reap;        // reaped, or left a zombie
        VSReturnCode regionCode;
        uint32_t runStatus; // 0: the short info query fails with "no such process"
    };
    const Case cases[] = {
        {"reaped before any query", false, true, vs::kReturnDeadPort, 0},
        {"zombie before any query", false, false, vs::kReturnDeadPort, vs::kRunStatusZombie},
        // Already parsed: the walk goes on from the parse without crashing.
        {"reaped while being walked", true, true, vs::kReturnNoMoreRegions, 0},
    };
    for (const Case &c : cases) {
        ChildProcess child({"anon:a:4:4", "thread:t"});
        ASSERT_TRUE(child.ready()) << c.what;
        VSTaskHandle task = 0;
        ASSERT_EQ(platform.task_handle_for_pid(child.pid(), task), 0) << c.what;
        std::vector<WalkedRegion> before;
        if (c.parseBefore) {
            uint64_t address = 0;
            uint64_t size = 0;
            uint32_t depth = 0;
            uint32_t count = vs::kRegionInfoCount;
            WalkedRegion first;
            ASSERT_EQ(platform.region_recurse(task, address, size, depth, first.info, count), 0) << c.what;
        }
        child.kill(c.reap);
        if (!c.reap) {
            child.waitUntilZombie();
        }
        std::vector<WalkedRegion> regions;
        EXPECT_EQ(walk(platform, task, regions), c.regionCode) << c.what;

        std::vector<int32_t> words(4);
        uint64_t count = 0;
        EXPECT_EQ(platform.page_range_query(task, child.hex("a", "start"), 4 * kPage, words, count),
                  vs::kReturnInvalidArgument)
            << c.what;

        VSShortInfo info;
        int32_t error = 0;
        const int32_t stored = platform.pid_short_info(child.pid(), info, error);
        if (c.runStatus == 0) {
            EXPECT_EQ(stored, 0) << c.what;
            EXPECT_EQ(error, vs::kErrorNoSuchProcess) << c.what;
        } else {
            EXPECT_EQ(stored, static_cast<int32_t>(sizeof(VSShortInfo))) << c.what;
            EXPECT_EQ(info.runStatus, c.runStatus) << c.what;
        }
        VSTaskKernelMemoryInfo kernel;
        uint32_t words8 = vs::kTaskKernelMemoryInfoCount;
        EXPECT_NE(platform.task_memory_info(task, kernel, words8), 0) << c.what;
        EXPECT_EQ(platform.error_text(vs::kReturnDeadPort).empty(), false);
        child.reap();

        VSTaskHandle again = 0;
        EXPECT_EQ(platform.task_handle_for_pid(child.pid(), again), ESRCH) << c.what;
        EXPECT_EQ(again, 0u);
        platform.release_task_handle(task);
    }
    EXPECT_EQ(platform.error_text(ESRCH), "No such process");
}

// Runs `body` in a forked child that has given up root, and returns what
// it wrote into the pipe.
template <typename Body>
std::vector<int32_t> asNobody(Body body) {
    int fds[2];
    EXPECT_EQ(pipe(fds), 0);
    const pid_t pid = fork();
    if (pid == 0) {
        close(fds[0]);
        if (setgid(65534) != 0 || setuid(65534) != 0) {
            _exit(3);
        }
        const std::vector<int32_t> results = body();
        const ssize_t bytes = static_cast<ssize_t>(results.size() * sizeof(int32_t));
        _exit(write(fds[1], results.data(), results.size() * sizeof(int32_t)) == bytes ? 0 : 4);
    }
    close(fds[1]);
    std::vector<int32_t> results(16);
    const ssize_t n = read(fds[0], results.data(), results.size() * sizeof(int32_t));
    close(fds[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    results.resize(n > 0 ? static_cast<size_t>(n) / sizeof(int32_t) : 0);
    return results;
}

TEST_F(LinuxProcessTest, AnotherUsersProcessIsRefused) {
    ChildProcess child({"anon:a:1:1"});
    ASSERT_TRUE(child.ready());
    const int target = child.pid();
    const auto results = asNobody([target] {
        VSLinuxPlatform unprivileged;
        VSTaskHandle task = 0;
        const VSReturnCode code = unprivileged.task_handle_for_pid(target, task);
        VSBsdInfo info;
        const int32_t bsdBytes = unprivileged.pid_bsd_info(target, info);
        std::span<const VSKernelZoneName> names;
        std::span<const VSKernelZoneInfo> zones;
        std::span<const VSKernelSiteInfo> sites;
        const VSReturnCode kernel = unprivileged.kernel_memory_info(names, zones, sites);
        return std::vector<int32_t>{code, static_cast<int32_t>(task), bsdBytes,
                                    static_cast<int32_t>(info.flags & vs::kBsdInfoFlag64Bit), kernel};
    });
    ASSERT_EQ(results.size(), 5u);
    EXPECT_EQ(results[0], EACCES) << "the handle is refused";
    EXPECT_EQ(results[1], 0) << "and no handle is handed out";
    EXPECT_EQ(platform.error_text(results[0]), "Permission denied");
    // The process list stays readable; the pointer width falls back to ours.
    EXPECT_EQ(results[2], static_cast<int32_t>(sizeof(VSBsdInfo)));
    EXPECT_EQ(results[3], static_cast<int32_t>(vs::kBsdInfoFlag64Bit));
    EXPECT_EQ(results[4], EACCES) << "the kernel's memory files are root-only";
    child.end();
}

TEST_F(LinuxProcessTest, ProcessRecords) {
    ChildProcess child({"anon:a:16:16", "mlock:m:2", "thread:t"});
    ASSERT_TRUE(child.ready());

    // The process list: the kernel first, no kernel threads, the child.
    const int32_t total = platform.list_all_pids({});
    ASSERT_GT(total, 1);
    std::vector<int32_t> pids(static_cast<size_t>(total) + 20);
    const int32_t stored = platform.list_all_pids(pids);
    ASSERT_GT(stored, 1);
    pids.resize(static_cast<size_t>(stored));
    EXPECT_EQ(pids.front(), 0);
    EXPECT_TRUE(std::is_sorted(pids.begin(), pids.end()));
    EXPECT_NE(std::find(pids.begin(), pids.end(), child.pid()), pids.end());
    EXPECT_NE(std::find(pids.begin(), pids.end(), getpid()), pids.end());
    EXPECT_EQ(std::find(pids.begin(), pids.end(), 2), pids.end()) << "kthreadd is a kernel thread";
    std::vector<int32_t> two(2);
    EXPECT_EQ(platform.list_all_pids(two), 2) << "a small buffer takes what fits";

    struct BsdCase {
        int32_t pid;
        int32_t bytes;
        uint32_t flags;
        uint32_t ppid;
        const char *name;
    };
    const BsdCase bsd[] = {
        {0, sizeof(VSBsdInfo), vs::kBsdInfoFlagSystem | vs::kBsdInfoFlag64Bit, 0, "kernel"},
        {child.pid(), sizeof(VSBsdInfo), vs::kBsdInfoFlag64Bit, static_cast<uint32_t>(getpid()), "vs_memchild"},
        {-5, 0, 0, 0, ""},
        {0x3FFFFFFF, 0, 0, 0, ""}, // above pid_max: no such process
    };
    for (const BsdCase &c : bsd) {
        VSBsdInfo info;
        EXPECT_EQ(platform.pid_bsd_info(c.pid, info), c.bytes) << c.pid;
        if (c.bytes == 0) {
            continue;
        }
        EXPECT_EQ(info.flags, c.flags) << c.pid;
        EXPECT_EQ(info.pid, static_cast<uint32_t>(c.pid));
        EXPECT_EQ(info.ppid, c.ppid) << c.pid;
        EXPECT_EQ(std::string(info.name, strnlen(info.name, sizeof info.name)), c.name);
        EXPECT_EQ(std::string(info.commandName, strnlen(info.commandName, sizeof info.commandName)), c.name);
    }

    // The argument area: count, executable path, padding, arguments.
    int32_t maxSize = 0;
    ASSERT_EQ(platform.argument_area_max_size(maxSize), 0);
    ASSERT_GT(maxSize, 4096);
    std::string area(static_cast<size_t>(maxSize), '\0');
    size_t length = 0;
    ASSERT_EQ(platform.process_argument_area(child.pid(), std::span<char>(area.data(), area.size()), length), 0);
    area.resize(length);
    uint32_t argc = 0;
    std::memcpy(&argc, area.data(), sizeof argc);
    EXPECT_EQ(argc, 4u);
    char exe[PATH_MAX];
    ASSERT_NE(realpath((std::string(VESTAGE_TEST_BIN_DIR) + "/vs_memchild").c_str(), exe), nullptr);
    EXPECT_EQ(std::string(area.c_str() + 4), exe);
    EXPECT_NE(area.find(std::string("anon:a:16:16\0mlock:m:2", 23)), std::string::npos);
    EXPECT_EQ(nameFromArgumentArea(area), "vs_memchild");
    std::string tiny(10, 'x');
    ASSERT_EQ(platform.process_argument_area(child.pid(), std::span<char>(tiny.data(), tiny.size()), length), 0);
    EXPECT_EQ(length, 10u) << "a short buffer takes the beginning";
    EXPECT_NE(platform.process_argument_area(0x3FFFFFFF, std::span<char>(area.data(), area.size()), length), 0);

    // Counters charged to the whole process.
    VSResourceUsageInfo usage;
    ASSERT_EQ(platform.pid_resource_usage(child.pid(), vs::kResourceUsageVersion4, usage), 0);
    EXPECT_GE(usage.physVestage, 18 * kPage) << "at least the pages the child wrote";
    EXPECT_GE(usage.lifetimeMaxPhysVestage, 18 * kPage);
    VSTaskHandle task = 0;
    ASSERT_EQ(platform.task_handle_for_pid(child.pid(), task), 0);
    VSTaskKernelMemoryInfo kernel;
    uint32_t count = vs::kTaskKernelMemoryInfoCount;
    ASSERT_EQ(platform.task_memory_info(task, kernel, count), 0);
    EXPECT_GE(kernel.privateAllocated, 2 * 16 * 1024u) << "two threads, two kernel stacks";
    EXPECT_EQ(kernel.sharedAllocated, 0u);

    VSShortInfo shortInfo;
    int32_t error = -1;
    EXPECT_EQ(platform.pid_short_info(child.pid(), shortInfo, error), static_cast<int32_t>(sizeof(VSShortInfo)));
    EXPECT_NE(shortInfo.runStatus, vs::kRunStatusZombie);
    uint32_t flags = 77;
    platform.pid_dirty_flags(child.pid(), flags);
    EXPECT_EQ(flags, 0u) << "no idle-exit tracking on Linux";
    EXPECT_EQ(platform.target_platform_code(child.pid(), true), VSPlatformNone);
    int32_t state = -1;
    EXPECT_NE(platform.purgeable_control(task, child.hex("a", "start"), vs::kPurgeableGetState, state), 0);
    child.end();
}

TEST_F(LinuxProcessTest, CrashHelperFindsThePidfdOnDescriptorThree) {
    ChildProcess child({"anon:a:3:3"});
    ASSERT_TRUE(child.ready());
    const int target = child.pid();
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    const pid_t helper = fork();
    if (helper == 0) {
        close(fds[0]);
        VSLinuxPlatform layer;
        std::vector<uint32_t> ports;
        // Nothing on fd 3 yet: no port.
        close(3);
        int32_t results[4] = {layer.ports_lookup(ports), static_cast<int32_t>(ports.size()), 0, 0};
        const int pidfd = static_cast<int>(syscall(SYS_pidfd_open, target, 0));
        if (pidfd < 0 || (pidfd != 3 && dup2(pidfd, 3) != 3)) {
            _exit(3);
        }
        layer.ports_lookup(ports);
        results[2] = static_cast<int32_t>(ports.size());
        if (!ports.empty()) {
            std::vector<vs::SmapsRegion> regions;
            results[3] = layer.task_pid(ports[0]) == target && layer.task_regions(ports[0], regions) == 0 &&
                                 !regions.empty()
                             ? 1
                             : 0;
        }
        _exit(write(fds[1], results, sizeof results) == sizeof results ? 0 : 4);
    }
    close(fds[1]);
    int32_t results[4] = {-1, -1, -1, -1};
    EXPECT_EQ(read(fds[0], results, sizeof results), static_cast<ssize_t>(sizeof results));
    close(fds[0]);
    int status = 0;
    waitpid(helper, &status, 0);
    EXPECT_EQ(results[0], 0);
    EXPECT_EQ(results[1], 0) << "no pidfd, no port";
    EXPECT_EQ(results[2], 1) << "the pidfd becomes the first port";
    EXPECT_EQ(results[3], 1) << "and the port reads the crashing process";
    child.end();
}

TEST_F(LinuxProcessTest, SmapsLargerThanTheFirstReadIsReadWhole) {
    // 600 mappings print far more smaps text than the first read takes;
    // alternating protections keep the kernel from merging them.
    // An inaccessible page on either side keeps the ends from merging with
    // whatever the test process happens to have mapped next to them.
    constexpr size_t kMappings = 600;
    char *outer = static_cast<char *>(
        mmap(nullptr, (kMappings + 2) * kPage, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    ASSERT_NE(outer, MAP_FAILED);
    char *base = outer + kPage;
    ASSERT_EQ(mprotect(base, kMappings * kPage, PROT_READ), 0);
    for (size_t i = 0; i < kMappings; i += 2) {
        ASSERT_EQ(mprotect(base + i * kPage, kPage, PROT_READ | PROT_WRITE), 0);
        base[i * kPage] = 1;
    }
    VSTaskHandle task = 0;
    ASSERT_EQ(platform.task_handle_for_pid(getpid(), task), 0);
    std::vector<WalkedRegion> regions;
    EXPECT_EQ(walk(platform, task, regions), vs::kReturnNoMoreRegions);
    size_t found = 0;
    for (size_t i = 0; i < kMappings; ++i) {
        const WalkedRegion *r = containing(regions, reinterpret_cast<uint64_t>(base + i * kPage));
        if (r != nullptr && r->start == reinterpret_cast<uint64_t>(base + i * kPage) && r->size == kPage) {
            ++found;
            EXPECT_EQ(r->info.residentPages, i % 2 == 0 ? 1u : 0u) << i;
        }
    }
    EXPECT_EQ(found, kMappings);
    platform.release_task_handle(task);
    munmap(outer, (kMappings + 2) * kPage);
}

TEST_F(LinuxProcessTest, KernelMemoryAndSettings) {
    std::span<const VSKernelZoneName> names;
    std::span<const VSKernelZoneInfo> zones;
    std::span<const VSKernelSiteInfo> sites;
    ASSERT_EQ(platform.kernel_memory_info(names, zones, sites), 0);
    ASSERT_FALSE(zones.empty());
    EXPECT_EQ(names.size(), zones.size());
    bool sawDentry = false;
    for (size_t i = 0; i < zones.size(); ++i) {
        const std::string name(names[i].name, strnlen(names[i].name, sizeof names[i].name));
        EXPECT_EQ(zones[i].currentSize % kPage, 0u) << name;
        EXPECT_LE(zones[i].elementsInUse * zones[i].elementSize, zones[i].currentSize) << name;
        if (name == "dentry") {
            sawDentry = true;
            EXPECT_NE(zones[i].collectable, 0u) << "dentries are reclaimable";
        }
    }
    EXPECT_TRUE(sawDentry);
    bool sawStacks = false;
    bool sawCounter = false;
    for (const VSKernelSiteInfo &site : sites) {
        const uint64_t type = site.flags & vs::kSiteTypeMask;
        sawStacks = sawStacks || (type == vs::kSiteTypeTag && site.site == 8 && site.size > 0);
        sawCounter = sawCounter || (site.flags == vs::kSiteTypeCounter && site.site == 0 && site.mapped > 0);
    }
    EXPECT_TRUE(sawStacks) << "kernel stacks from meminfo";
    EXPECT_TRUE(sawCounter) << "MemTotal as the managed-pages counter";

    EXPECT_EQ(platform.release_memory(zones.data(), zones.size_bytes()), 0);
    EXPECT_NE(platform.release_memory(zones.data(), zones.size_bytes()), 0) << "released once";
    EXPECT_EQ(platform.release_memory(names.data(), names.size_bytes()), 0);
    EXPECT_EQ(platform.release_memory(sites.data(), sites.size_bytes()), 0);

    auto symbolicator = platform.kernel_symbolicator();
    ASSERT_NE(symbolicator, nullptr);
    EXPECT_FALSE(symbolicator->symbol_name_at(1).has_value()) << "below the kernel's first symbol";

    int32_t value = -1;
    EXPECT_EQ(platform.sysctl_by_name_read("vm.self_region_vestage", value), ENOENT);
    ASSERT_EQ(platform.sysctl_by_name_read("vm.overcommit_memory", value), 0);
    EXPECT_GE(value, 0);
    EXPECT_LE(value, 2);
    EXPECT_EQ(platform.own_pid(), getpid());
    EXPECT_EQ(platform.effective_user_id(), 0u);
    EXPECT_EQ(platform.kernel_page_size(), kPage);
}

} // namespace
