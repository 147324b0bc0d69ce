// The Linux layer against real child processes whose memory the test
// arranges (tests/helpers/vs_memchild.cpp): every figure is compared page
// for page with what the child was told to do.

#include "model/memory_region.h"
#include "targets/platform/linux/linux_platform.h"
#include "targets/platform/linux/proc_reader.h"
#include "targets/platform/linux/proc_text.h"
#include "targets/platform/linux/smaps_parser.h"
#include "tests/support/run_program.h"

#include <algorithm>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <link.h>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <tuple>
#include <sched.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace {

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
const std::string kMemChild = std::string(VESTAGE_TEST_BIN_DIR) + "/vs_memchild";

using vs::test::MemChild;

uint64_t hex(const MemChild &child, const std::string &label, const std::string &key) {
    return std::strtoull(child.fact(label, key).c_str(), nullptr, 16);
}

// Kills the child, then reaps it or leaves it a zombie.
void kill(const MemChild &child, bool reap) {
    ::kill(child.pid(), SIGKILL);
    siginfo_t info{};
    waitid(P_PID, static_cast<id_t>(child.pid()), &info, WEXITED | (reap ? 0 : WNOWAIT));
}

struct WalkedRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    VSRegionInfo info;
};

// The walk as the targets do it: each answer's end is the next question.
VSReturnCode walk(VSLinuxPlatform &platform, VSTaskHandle task, std::vector<WalkedRegion> &out,
                  size_t limit = SIZE_MAX) {
    for (uint64_t address = 0; out.size() < limit;) {
        WalkedRegion r;
        uint32_t depth = vs::kUnlimitedDepth, count = vs::kRegionInfoCount;
        const VSReturnCode code = platform.region_recurse(task, address, r.size, depth, r.info, count);
        if (code != 0) {
            return code;
        }
        EXPECT_EQ(depth, 0u);
        r.start = address;
        out.push_back(r);
        address += r.size;
    }
    return 0;
}

const WalkedRegion *containing(const std::vector<WalkedRegion> &regions, uint64_t address) {
    for (const WalkedRegion &r : regions) {
        if (r.start <= address && address < r.start + r.size) {
            return &r;
        }
    }
    return nullptr;
}

// A file of `pages` pages, written back so that its page cache is clean.
std::string makeCleanFile(const char *name, size_t pages) {
    const std::string path = std::string(VESTAGE_TEST_BIN_DIR) + "/" + name;
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    const std::string bytes(pages * kPage, 'v');
    EXPECT_EQ(write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size())) << path;
    fsync(fd);
    close(fd);
    return path;
}

class LinuxProcessTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the Linux layer tests read other processes and need root";
        }
    }
    VSTaskHandle taskFor(int pid) {
        VSTaskHandle task = 0;
        EXPECT_EQ(platform.task_handle_for_pid(pid, task), 0);
        return task;
    }
    VSLinuxPlatform platform;
};

TEST_F(LinuxProcessTest, ArrangedMemoryPageForPage) {
    const std::string file = makeCleanFile("vs_linux_test_file", 3);
    const std::string shm = "vs_linux_test_" + std::to_string(getpid());
    MemChild child({"anon:a:8:5", "anon:u:4:0", "file:f:" + file, "shared:s:4", "shm:p:" + shm + ":2",
                    "mlock:m:3", "free:fr:8:3", "exec:e:2", "none:n:2", "thread:t"});
    ASSERT_TRUE(child.ready());
    const VSTaskHandle task = taskFor(child.pid());
    std::vector<WalkedRegion> regions;
    ASSERT_EQ(walk(platform, task, regions), vs::kReturnNoMoreRegions);

    struct Expect {
        const char *label;
        uint32_t resident, dirtied, reusable, wired;
        uint8_t shareMode;
        uint32_t tag;
        uint8_t external;
        std::string path;
    };
    const Expect expected[] = {
        {"a", 5, 5, 0, 0, vs::kShareModePrivate, 0, 0, ""},
        {"u", 0, 0, 0, 0, vs::kShareModeEmpty, 0, 0, ""},
        {"f", 3, 0, 0, 0, vs::kShareModeShared, 0, 1, file},
        // Shared memory has no pager, yet it is a mapped file with a path.
        {"s", 4, 4, 0, 0, vs::kShareModeShared, vs::kTagDevZero, 0, "/dev/zero (deleted)"},
        {"p", 2, 2, 0, 0, vs::kShareModeShared, vs::kTagPosixSharedMemory, 0, "/dev/shm/" + shm},
        {"m", 3, 3, 0, 3, vs::kShareModePrivate, 0, 0, ""},
        {"fr", 8, 5, 3, 0, vs::kShareModePrivate, 0, 0, ""},
        {"e", 2, 2, 0, 0, vs::kShareModePrivate, vs::kTagJitCode, 0, ""},
        {"n", 0, 0, 0, 0, vs::kShareModeEmpty, vs::kTagGuard, 0, ""},
    };
    for (const Expect &e : expected) {
        SCOPED_TRACE(e.label);
        const uint64_t start = hex(child, e.label, "start");
        const WalkedRegion *r = containing(regions, start);
        ASSERT_NE(r, nullptr);
        EXPECT_EQ(r->start, start);
        EXPECT_EQ(r->size, hex(child, e.label, "size"));
        EXPECT_EQ(r->info.residentPages, e.resident);
        EXPECT_EQ(r->info.dirtiedPages, e.dirtied);
        EXPECT_EQ(r->info.reusablePages, e.reusable);
        EXPECT_EQ(r->info.userWiredCount, e.wired);
        EXPECT_EQ(r->info.shareMode, e.shareMode);
        EXPECT_EQ(r->info.userTag, e.tag);
        EXPECT_EQ(r->info.externalPager, e.external);
        EXPECT_NE(r->info.objectId, 0u);
        char path[vs::kRegionFilenameBufferSize];
        const int32_t length = platform.pid_region_filename(child.pid(), start, path);
        EXPECT_EQ(std::string(path, static_cast<size_t>(std::max(length, 0))), e.path);

        // region_info inside the region answers from the same parse.
        uint64_t address = start + 1, size = 0;
        VSRegionBasicInfo basic;
        uint32_t count = vs::kRegionBasicInfoCount, objectName = 0;
        ASSERT_EQ(platform.region_info(task, address, size, vs::kRegionBasicInfoFlavor, basic, count, objectName), 0);
        EXPECT_EQ(std::make_tuple(address, size, basic.protection), std::make_tuple(start, r->size, r->info.protection));
    }

    // A walk that reached the end gave its parse back; walking the same
    // handle again parses anew and finds the same regions.
    std::vector<WalkedRegion> again;
    ASSERT_EQ(walk(platform, task, again), vs::kReturnNoMoreRegions);
    ASSERT_EQ(again.size(), regions.size());
    for (size_t i = 0; i < regions.size(); ++i) {
        EXPECT_EQ(std::tie(again[i].start, again[i].size, again[i].info.userTag, again[i].info.protection),
                  std::tie(regions[i].start, regions[i].size, regions[i].info.userTag, regions[i].info.protection));
    }

    // The blocked thread's stack is "stack"; the no-access page the thread
    // library leaves below it is "guard".
    const WalkedRegion *stack = containing(regions, hex(child, "t", "local"));
    ASSERT_NE(stack, nullptr);
    EXPECT_EQ(stack->info.userTag, vs::kTagStack);
    const WalkedRegion *guard = containing(regions, stack->start - 1);
    ASSERT_NE(guard, nullptr);
    EXPECT_EQ(guard->info.userTag, vs::kTagGuard);
    EXPECT_EQ(guard->info.protection, 0);

    // Page by page: an unaligned start and length still cover whole pages,
    // and nothing is written past the room given.
    constexpr int32_t P = vs::kPageDispositionPresent;
    constexpr int32_t X = vs::kPageDispositionExternal;
    const std::pair<std::string, std::vector<int32_t>> pages[] = {
        {"a", {P, P, P, P, P, 0, 0, 0}},
        {"f", {P | X, P | X, P | X}},
        {"s", {P, P, P, P}}, // shared anonymous pages are not file-backed
    };
    for (const auto &[label, expectedWords] : pages) {
        // The file was written back, so none of its pages is dirty.
        const int32_t mask = P | X | vs::kPageDispositionPagedOut | (label == "f" ? vs::kPageDispositionDirty : 0);
        std::vector<int32_t> words(expectedWords.size() + 1, -1);
        uint64_t count = 0;
        ASSERT_EQ(platform.page_range_query(task, hex(child, label, "start") + 10, expectedWords.size() * kPage - 10,
                                            std::span<int32_t>(words.data(), expectedWords.size()), count),
                  0);
        EXPECT_EQ(words.back(), -1) << label;
        words.resize(count);
        std::transform(words.begin(), words.end(), words.begin(), [&](int32_t w) { return w & mask; });
        EXPECT_EQ(words, expectedWords) << label;
    }
    EXPECT_EQ(platform.release_task_handle(task), 0);
    EXPECT_NE(platform.release_task_handle(task), 0) << "a handle is released once";
    unlink(("/dev/shm/" + shm).c_str());
}

TEST_F(LinuxProcessTest, SharedMappingIsOneObjectAcrossProcesses) {
    const std::string file = makeCleanFile("vs_linux_test_shared_file", 2);
    MemChild child({"shared:s:4", "file:f:" + file, "anon:a:2:2", "fork:g"});
    ASSERT_TRUE(child.ready());
    std::vector<WalkedRegion> parent;
    std::vector<WalkedRegion> grandchild;
    ASSERT_EQ(walk(platform, taskFor(child.pid()), parent), vs::kReturnNoMoreRegions);
    ASSERT_EQ(walk(platform, taskFor(std::stoi(child.fact("g", "pid"))), grandchild), vs::kReturnNoMoreRegions);

    struct Case {
        const char *label;
        bool sameObject;
        std::optional<uint8_t> shareMode;
    };
    // Until a run has resolved what its targets share, private anonymous
    // memory is each process's own, even where fork left it shared.
    const Case cases[] = {{"s", true, vs::kShareModeShared},
                          {"f", true, std::nullopt},
                          {"a", false, vs::kShareModePrivate}};
    for (const Case &c : cases) {
        const WalkedRegion *one = containing(parent, hex(child, c.label, "start"));
        const WalkedRegion *two = containing(grandchild, hex(child, c.label, "start"));
        ASSERT_TRUE(one && two) << c.label;
        EXPECT_EQ(one->info.objectId == two->info.objectId, c.sameObject) << c.label;
        EXPECT_EQ(one->info.shareMode, c.shareMode.value_or(one->info.shareMode)) << c.label;
        EXPECT_EQ(two->info.shareMode, c.shareMode.value_or(two->info.shareMode)) << c.label;
    }
    const WalkedRegion *shared = containing(grandchild, hex(child, "s", "start"));
    EXPECT_EQ(shared->info.dirtiedPages, 4u);
    EXPECT_EQ(shared->info.inheritance, vs::kInheritShare);
}

TEST_F(LinuxProcessTest, PagesSharedByTargetsCountOnce) {
    const std::string clean = makeCleanFile("vs_linux_test_private_file", 4);
    const std::string big = makeCleanFile("vs_linux_test_big_file", 256);
    // Page cache dirtied by write(), not yet written back.
    const std::string dirtied = std::string(VESTAGE_TEST_BIN_DIR) + "/vs_linux_test_dirty_file";
    {
        const int fd = open(dirtied.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        const std::string bytes(4 * kPage, 'd');
        ASSERT_EQ(write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
        close(fd);
    }
    const std::string shm = "/dev/shm/vs_linux_test_private_" + std::to_string(getpid());
    {
        const int fd = open(shm.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        ASSERT_EQ(ftruncate(fd, static_cast<off_t>(2 * kPage)), 0);
        close(fd);
    }
    // A part: "own" for the mapping's own object, else a name; parts named
    // alike must be one object in every process, parts named apart not.
    struct Part {
        std::string object;
        uint32_t resident; // kUnion: the pages any of the item's mappings holds
    };
    // Faulting in a file page maps as many cached neighbours as the kernel
    // likes; which pages each mapping holds is the kernel's pagemap.
    constexpr uint32_t kUnion = UINT32_MAX;
    struct Seen {
        std::string process; // "" the child, else a grandchild's label
        std::string item;
        std::vector<Part> parts;
    };
    struct Scene {
        const char *what;
        std::vector<std::string> items;
        std::vector<Seen> seen;
    };
    const Scene scenes[] = {
        {"a fork family that only reads",
         {"anon:a:64:64", "fork:g1", "fork:g2"},
         {{"", "a", {{"S", 64}}}, {"g1", "a", {{"S", 64}}}, {"g2", "a", {{"S", 64}}}}},
        {"one child writes a quarter: its own copies, the rest by exact set",
         {"anon:a:64:64", "fork:g1:a:0:16", "fork:g2"},
         {{"", "a", {{"PG2", 16}, {"ALL", 48}}},
          {"g1", "a", {{"own", 16}, {"ALL", 48}}},
          {"g2", "a", {{"PG2", 16}, {"ALL", 48}}}}},
        {"a shared region written in parts by the children",
         {"shared:s:64:0", "fork:g1:s:0:16", "fork:g2:s:16:16", "fork:g3:s:32:16"},
         {{"", "s", {{"S", 48}}}, {"g1", "s", {{"S", 48}}}, {"g2", "s", {{"S", 48}}}, {"g3", "s", {{"S", 48}}}}},
        {"a shared file written in parts", {"sfile:s:" + big, "fork:g1:s:0:1", "fork:g2:s:128:1"},
         {{"", "s", {{"F", kUnion}}}, {"g1", "s", {{"F", kUnion}}}, {"g2", "s", {{"F", kUnion}}}}},
        {"two private mappings of one file hold two sets of copies",
         {"pfile:x:" + clean + ":4", "pfile:y:" + clean + ":4"},
         {{"", "x", {{"own", 4}}}, {"", "y", {{"own", 4}}}}},
        {"page cache dirtied by write() is the file's, not the reader's",
         {"file:f:" + dirtied}, {{"", "f", {{"D", 4}}}}},
        // Read whole, the frames of 256 GiB of address space would take
        // minutes; only the pages it holds are looked at.
        {"a sparse reservation shared after fork", {"sparse:r:256:3", "fork:g1"},
         {{"", "r", {{"S", 3}}}, {"g1", "r", {{"S", 3}}}}},
        {"a private mapping of shmem written by two processes: copies of each",
         {"pfile:p:" + shm + ":2", "fork:g1:p:0:2"},
         {{"", "p", {{"own", 2}}}, {"g1", "p", {{"own", 2}}}}},
    };
    for (const Scene &scene : scenes) {
        SCOPED_TRACE(scene.what);
        VSLinuxPlatform run; // one run per scene: sets are of a run's targets
        MemChild child(scene.items);
        ASSERT_TRUE(child.ready());
        std::map<std::string, VSTaskHandle> tasks;
        for (const Seen &seen : scene.seen) {
            if (!tasks.count(seen.process)) {
                const int pid = seen.process.empty() ? child.pid() : std::stoi(child.fact(seen.process, "pid"));
                VSTaskHandle task = 0;
                ASSERT_EQ(run.task_handle_for_pid(pid, task), 0);
                tasks[seen.process] = task;
            }
        }
        for (const auto &[name, task] : tasks) {
            run.prepare_task_walk(task);
        }
        ASSERT_TRUE(run.resolve_shared_pages());
        // The pages of each item that any of its mappings has present.
        std::map<std::string, std::vector<bool>> present;
        for (const Seen &seen : scene.seen) {
            if (std::none_of(seen.parts.begin(), seen.parts.end(), [&](const Part &p) { return p.resident == kUnion; })) {
                continue;
            }
            const int pid = seen.process.empty() ? child.pid() : std::stoi(child.fact(seen.process, "pid"));
            const uint64_t pages = hex(child, seen.item, "size") / kPage;
            std::vector<uint64_t> entries(pages);
            const int fd = open(("/proc/" + std::to_string(pid) + "/pagemap").c_str(), O_RDONLY | O_CLOEXEC);
            ASSERT_EQ(pread(fd, entries.data(), pages * 8, static_cast<off_t>(hex(child, seen.item, "start") / kPage * 8)),
                      static_cast<ssize_t>(pages * 8));
            close(fd);
            std::vector<bool> &bits = present[seen.item];
            bits.resize(pages);
            for (uint64_t i = 0; i < pages; ++i) {
                bits[i] = bits[i] || (entries[i] >> 63) != 0;
            }
        }
        std::map<std::string, uint32_t> unionPages;
        for (const auto &[item, bits] : present) {
            unionPages[item] = static_cast<uint32_t>(std::count(bits.begin(), bits.end(), true));
        }
        std::map<std::string, uint32_t> named;
        std::set<uint32_t> objects;
        for (const Seen &seen : scene.seen) {
            SCOPED_TRACE(seen.process + " " + seen.item);
            const VSTaskHandle task = tasks[seen.process];
            const uint64_t start = hex(child, seen.item, "start");
            std::vector<WalkedRegion> regions;
            uint64_t address = start, size = 0;
            uint32_t depth = vs::kUnlimitedDepth, count = vs::kRegionInfoCount;
            VSRegionInfo first;
            ASSERT_EQ(run.region_recurse(task, address, size, depth, first, count), 0);
            ASSERT_EQ(address, start);
            std::vector<VSRegionInfo> parts;
            ASSERT_EQ(run.region_parts(task, start, parts), 0);
            ASSERT_FALSE(parts.empty());
            EXPECT_EQ(parts[0].objectId, first.objectId) << "the walk's record is the first part";
            std::vector<std::pair<uint32_t, std::string>> got, want;
            for (const VSRegionInfo &part : parts) {
                if (part.shareMode == vs::kShareModeEmpty) {
                    continue;
                }
                EXPECT_TRUE(objects.insert(part.objectId).second || part.shareMode == vs::kShareModeShared)
                    << "an object of its own is no other part's";
                got.emplace_back(part.residentPages, part.shareMode == vs::kShareModePrivate ? "own" : "shared");
            }
            for (const Part &part : seen.parts) {
                want.emplace_back(part.resident == kUnion ? unionPages[seen.item] : part.resident,
                                  part.object == "own" ? "own" : "shared");
            }
            std::sort(got.begin(), got.end());
            std::sort(want.begin(), want.end());
            EXPECT_EQ(got, want);
            // Named parts: the same object wherever the name appears.
            for (const Part &part : seen.parts) {
                if (part.object == "own") {
                    continue;
                }
                const uint32_t resident = part.resident == kUnion ? unionPages[seen.item] : part.resident;
                const auto match = std::find_if(parts.begin(), parts.end(), [&](const VSRegionInfo &p) {
                    return p.residentPages == resident && p.shareMode == vs::kShareModeShared;
                });
                ASSERT_NE(match, parts.end());
                const auto [entry, added] = named.emplace(part.object, match->objectId);
                EXPECT_EQ(entry->second, match->objectId) << part.object << " is one object";
                for (const auto &[other, id] : named) {
                    if (other != part.object) {
                        EXPECT_NE(id, match->objectId) << part.object << " and " << other << " are two";
                    }
                }
            }
        }
        for (const auto &[name, task] : tasks) {
            run.release_task_handle(task);
        }
    }
    unlink(shm.c_str());
    unlink(dirtied.c_str());
    unlink(big.c_str());
    unlink(clean.c_str());
}

TEST_F(LinuxProcessTest, SharedLibrarySegments) {
    MemChild child({"libc:l"});
    ASSERT_TRUE(child.ready());
    const std::string libcPath = child.fact("l", "path");
    const uint64_t bias = hex(child, "l", "bias");
    const auto images = platform.symbolicator(taskFor(child.pid()), vs::kSymbolicatorImagesOnly);
    const auto libc = std::find_if(images.begin(), images.end(), [&](const auto &i) { return i.path == libcPath; });
    ASSERT_NE(libc, images.end()) << libcPath;
    char helper[PATH_MAX];
    ASSERT_NE(realpath(kMemChild.c_str(), helper), nullptr);
    EXPECT_TRUE(std::any_of(images.begin(), images.end(), [&](const auto &i) { return i.path == helper; }));

    // Every PT_LOAD of libc (the same file in this process) shows as a
    // segment at the child's bias + vaddr, named by its protection, and
    // ends where the load ends.
    std::vector<ElfW(Phdr)> loads;
    dl_iterate_phdr(
        [](dl_phdr_info *info, size_t, void *out) {
            const bool isLibc = info->dlpi_name && std::strstr(info->dlpi_name, "/libc.so");
            for (int i = 0; isLibc && i < info->dlpi_phnum; ++i) {
                if (info->dlpi_phdr[i].p_type == PT_LOAD) {
                    static_cast<std::vector<ElfW(Phdr)> *>(out)->push_back(info->dlpi_phdr[i]);
                }
            }
            return isLibc ? 1 : 0;
        },
        &loads);
    ASSERT_FALSE(loads.empty());
    const uint64_t relro = hex(child, "l", "relro");
    auto segmentWhere = [&](auto predicate) {
        return std::find_if(libc->segments.begin(), libc->segments.end(), predicate);
    };
    size_t writable = 0;
    for (const ElfW(Phdr) &load : loads) {
        const uint64_t vaddr = load.p_vaddr;
        const uint64_t memsz = load.p_memsz;
        const bool isWritable = (load.p_flags & PF_W) != 0;
        writable += isWritable ? 1 : 0;
        const auto segment = segmentWhere([&](const auto &s) { return s.start == bias + vaddr; });
        ASSERT_NE(segment, libc->segments.end()) << std::hex << vaddr;
        EXPECT_EQ(segment->name, !isWritable ? "__TEXT" : (relro == vaddr ? "__DATA_CONST" : "__DATA")) << std::hex << vaddr;
        EXPECT_TRUE(isWritable || segment->length == memsz) << std::hex << vaddr;
        EXPECT_NE(segmentWhere([&](const auto &s) { return s.start + s.length == bias + vaddr + memsz; }),
                  libc->segments.end())
            << std::hex << vaddr;
    }
    EXPECT_EQ(writable, 1u);
    EXPECT_NE(segmentWhere([](const auto &s) { return s.name == "__DATA"; }), libc->segments.end());
}

// The process-wide counters against the child's own status. Its page
// tables are memory it costs: in its physical vestage and as kernel memory
// of its own. One page written per 2 MiB makes them weigh.
TEST_F(LinuxProcessTest, ProcessWideCountersIncludeThePageTables) {
    MemChild child({"tables:t:1", "shared:s:16"});
    ASSERT_TRUE(child.ready());
    std::string status;
    {
        char buffer[4096];
        const int fd = open(("/proc/" + std::to_string(child.pid()) + "/status").c_str(), O_RDONLY | O_CLOEXEC);
        for (ssize_t n; fd >= 0 && (n = read(fd, buffer, sizeof buffer)) > 0;) status.append(buffer, n);
        close(fd);
    }
    auto kilobytes = [&](const std::string &name) {
        const size_t at = status.find("\n" + name + ":");
        EXPECT_NE(at, std::string::npos) << name;
        return at == std::string::npos ? 0 : std::strtoull(status.c_str() + at + name.size() + 2, nullptr, 10) * 1024;
    };
    const uint64_t pageTables = kilobytes("VmPTE");
    ASSERT_GE(pageTables, 512 * kPage) << "a page table for each 2 MiB written";
    const uint64_t expected = kilobytes("RssAnon") + kilobytes("RssShmem") + kilobytes("VmSwap") + pageTables;
    EXPECT_GE(kilobytes("RssShmem"), 16 * kPage);

    const VSTaskHandle task = taskFor(child.pid());
    VSTaskKernelMemoryInfo kernel;
    uint32_t count = vs::kTaskKernelMemoryInfoCount;
    ASSERT_EQ(platform.task_memory_info(task, kernel, count), 0);
    EXPECT_GT(kernel.privateAllocated, pageTables) << "page tables and kernel stacks";
    // Asked right after the kernel memory (as a target does), then anew.
    for (const char *when : {"after the kernel memory", "on its own"}) {
        VSResourceUsageInfo usage;
        ASSERT_EQ(platform.pid_resource_usage(child.pid(), vs::kResourceUsageVersion4, usage), 0) << when;
        EXPECT_EQ(usage.physVestage, expected) << when << "\n" << status;
    }
    platform.release_task_handle(task);
}

TEST_F(LinuxProcessTest, ProcessThatGoesAwayWhileRead) {
    struct Case {
        const char *what;
        bool parseBefore; // the walk began while the child still lived
        bool reap;        // reaped, or left a zombie
        VSReturnCode walkCode;
        uint32_t runStatus; // 0: the short info query fails with "no such process"
    };
    const Case cases[] = {
        {"reaped before any query", false, true, vs::kReturnDeadPort, 0},
        {"zombie before any query", false, false, vs::kReturnDeadPort, vs::kRunStatusZombie},
        {"reaped while being walked", true, true, vs::kReturnNoMoreRegions, 0},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        MemChild child({"anon:a:4:4", "thread:t"});
        ASSERT_TRUE(child.ready());
        const VSTaskHandle task = taskFor(child.pid());
        std::vector<WalkedRegion> regions;
        ASSERT_EQ(walk(platform, task, regions, c.parseBefore ? 1 : 0), 0);
        kill(child, c.reap);
        EXPECT_EQ(walk(platform, task, regions), c.walkCode);
        std::vector<int32_t> words(4);
        uint64_t count = 0;
        EXPECT_EQ(platform.page_range_query(task, hex(child, "a", "start"), 4 * kPage, words, count),
                  vs::kReturnInvalidArgument);
        VSShortInfo info;
        int32_t error = 0;
        const int32_t stored = platform.pid_short_info(child.pid(), info, error);
        EXPECT_EQ(stored, c.runStatus == 0 ? 0 : static_cast<int32_t>(sizeof(VSShortInfo)));
        if (c.runStatus == 0) {
            EXPECT_EQ(error, vs::kErrorNoSuchProcess);
        } else {
            EXPECT_EQ(info.runStatus, c.runStatus);
        }
        waitpid(child.pid(), nullptr, 0);
        VSTaskHandle again = 0;
        EXPECT_EQ(platform.task_handle_for_pid(child.pid(), again), ESRCH);
        EXPECT_EQ(again, 0u);
        platform.release_task_handle(task);
    }
    EXPECT_EQ(platform.error_text(ESRCH), "No such process");
}

// Past its fd budget the layer holds no directory for a handle and opens
// /proc/PID for each query. By then the pid may name another process,
// which must read as the handle's process gone, never as the other one.
// A pid namespace of the test's own makes the pid's reuse certain.
TEST_F(LinuxProcessTest, HandleWithoutItsDirectoryNeverReadsALaterProcess) {
    constexpr int kUnsupported = 77;
    int report[2];
    ASSERT_EQ(pipe2(report, O_CLOEXEC), 0);
    const pid_t outer = fork();
    if (outer == 0) {
        if (unshare(CLONE_NEWPID | CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
            _exit(kUnsupported);
        }
        const pid_t init = fork(); // pid 1 of the new namespace
        if (init != 0) {
            int status = 0;
            waitpid(init, &status, 0);
            _exit(WIFEXITED(status) ? WEXITSTATUS(status) : 3);
        }
        if (mount("proc", "/proc", "proc", 0, nullptr) != 0) {
            _exit(kUnsupported);
        }
        const rlimit files{24, 24}; // too few for the layer to keep any directory
        setrlimit(RLIMIT_NOFILE, &files);
        auto sleeper = [] {
            const pid_t pid = fork();
            if (pid == 0) {
                pause();
                _exit(0);
            }
            return pid;
        };
        const pid_t first = sleeper();
        VSLinuxPlatform limited;
        VSTaskHandle task = 0;
        VSTaskKernelMemoryInfo info;
        uint32_t count = vs::kTaskKernelMemoryInfoCount;
        int32_t results[5] = {limited.task_handle_for_pid(first, task), limited.task_memory_info(task, info, count)};
        // Start times are in clock ticks: the later process starts in a later one.
        std::string_view stat;
        const auto started = vs::readFileAt(AT_FDCWD, ("/proc/" + std::to_string(first) + "/stat").c_str(), stat) == 0
                                 ? vs::parseStat(stat)
                                 : std::nullopt;
        const uint64_t ticksPerSecond = static_cast<uint64_t>(sysconf(_SC_CLK_TCK));
        for (timespec now{}; started && clock_gettime(CLOCK_BOOTTIME, &now) == 0 &&
                             static_cast<uint64_t>(now.tv_sec) * ticksPerSecond +
                                     static_cast<uint64_t>(now.tv_nsec) * ticksPerSecond / 1000000000 <=
                                 started->startTime;) {
            usleep(1000);
        }
        ::kill(first, SIGKILL);
        waitpid(first, nullptr, 0);
        const int lastPid = open("/proc/sys/kernel/ns_last_pid", O_WRONLY | O_CLOEXEC);
        const std::string before = std::to_string(first - 1);
        if (lastPid < 0 || write(lastPid, before.data(), before.size()) != static_cast<ssize_t>(before.size())) {
            _exit(kUnsupported);
        }
        close(lastPid);
        const pid_t second = sleeper();
        results[2] = second == first;
        count = vs::kTaskKernelMemoryInfoCount;
        results[3] = limited.task_memory_info(task, info, count);
        uint64_t address = 0, size = 0;
        uint32_t depth = 0, infoCount = vs::kRegionInfoCount;
        VSRegionInfo region;
        results[4] = limited.region_recurse(task, address, size, depth, region, infoCount);
        ::kill(second, SIGKILL);
        waitpid(second, nullptr, 0);
        _exit(write(report[1], results, sizeof results) == sizeof results ? 0 : 4);
    }
    close(report[1]);
    int32_t results[5] = {-1, -1, -1, -1, -1};
    const ssize_t got = read(report[0], results, sizeof results);
    close(report[0]);
    int status = 0;
    waitpid(outer, &status, 0);
    if (WIFEXITED(status) && WEXITSTATUS(status) == kUnsupported) {
        GTEST_SKIP() << "no pid namespace of our own here";
    }
    ASSERT_EQ(got, static_cast<ssize_t>(sizeof results)) << "status " << status;
    EXPECT_EQ(results[0], 0) << "the handle";
    EXPECT_EQ(results[1], 0) << "a query through a directory opened again";
    ASSERT_EQ(results[2], 1) << "the pid was handed on";
    EXPECT_EQ(results[3], vs::kReturnDeadPort) << "kernel memory of the later process";
    EXPECT_EQ(results[4], vs::kReturnDeadPort) << "regions of the later process";
}

TEST_F(LinuxProcessTest, ProcessThatExecsAfterItsHandleIsOpened) {
    // The handle is opened while the child still runs this program; the
    // walk must see the address space of the program it then becomes.
    int go[2], out[2];
    ASSERT_EQ(pipe2(go, O_CLOEXEC), 0);
    ASSERT_EQ(pipe2(out, O_CLOEXEC), 0);
    const pid_t pid = fork();
    if (pid == 0) {
        char byte;
        if (read(go[0], &byte, 1) != 1) {
            _exit(3);
        }
        dup2(go[0], 0); // it lives until the test closes its end
        dup2(out[1], 1);
        execl(kMemChild.c_str(), kMemChild.c_str(), "anon:a:6:6", nullptr);
        _exit(127);
    }
    close(go[0]);
    close(out[1]);
    const VSTaskHandle task = taskFor(pid);
    ASSERT_EQ(write(go[1], "x", 1), 1);
    std::string lines;
    char buffer[512];
    for (ssize_t n; lines.find("ready") == std::string::npos && (n = read(out[0], buffer, sizeof buffer)) > 0;) {
        lines.append(buffer, static_cast<size_t>(n));
    }
    const size_t at = lines.find("a start=");
    ASSERT_NE(at, std::string::npos) << lines;
    const uint64_t start = std::strtoull(lines.c_str() + at + 8, nullptr, 16);
    std::vector<WalkedRegion> regions;
    EXPECT_EQ(walk(platform, task, regions), vs::kReturnNoMoreRegions);
    const WalkedRegion *arranged = containing(regions, start);
    ASSERT_NE(arranged, nullptr);
    EXPECT_EQ(arranged->info.residentPages, 6u);
    close(go[1]); // end of input: the child exits
    close(out[0]);
    waitpid(pid, nullptr, 0);
    platform.release_task_handle(task);
}

TEST_F(LinuxProcessTest, AnotherUsersProcessIsRefused) {
    MemChild child({"anon:a:1:1"});
    ASSERT_TRUE(child.ready());
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    const pid_t pid = fork();
    if (pid == 0) {
        if (setgid(65534) != 0 || setuid(65534) != 0) {
            _exit(3);
        }
        VSLinuxPlatform unprivileged;
        VSTaskHandle task = 0;
        VSBsdInfo info;
        const int32_t results[] = {unprivileged.task_handle_for_pid(child.pid(), task), static_cast<int32_t>(task),
                                   unprivileged.pid_bsd_info(child.pid(), info),
                                   static_cast<int32_t>(info.flags & vs::kBsdInfoFlag64Bit)};
        _exit(write(fds[1], results, sizeof results) == sizeof results ? 0 : 4);
    }
    close(fds[1]);
    int32_t results[4] = {};
    EXPECT_EQ(read(fds[0], results, sizeof results), static_cast<ssize_t>(sizeof results));
    close(fds[0]);
    waitpid(pid, nullptr, 0);
    EXPECT_EQ(results[0], EACCES) << "the handle is refused";
    EXPECT_EQ(results[1], 0) << "and no handle is handed out";
    EXPECT_EQ(platform.error_text(results[0]), "Permission denied");
    // The process list stays readable; the pointer width falls back to ours.
    EXPECT_EQ(results[2], static_cast<int32_t>(sizeof(VSBsdInfo)));
    EXPECT_EQ(results[3], static_cast<int32_t>(vs::kBsdInfoFlag64Bit));
}

TEST_F(LinuxProcessTest, ProcessListRecordAndArguments) {
    MemChild child({"anon:a:16:16", "thread:t"});
    ASSERT_TRUE(child.ready());
    std::vector<int32_t> pids(static_cast<size_t>(platform.list_all_pids({})) + 20);
    pids.resize(static_cast<size_t>(std::max(platform.list_all_pids(pids), 0)));
    ASSERT_GT(pids.size(), 1u);
    EXPECT_EQ(pids.front(), 0) << "the kernel comes first";
    EXPECT_TRUE(std::is_sorted(pids.begin(), pids.end()));
    EXPECT_NE(std::find(pids.begin(), pids.end(), child.pid()), pids.end());
    EXPECT_EQ(std::find(pids.begin(), pids.end(), 2), pids.end()) << "kthreadd is a kernel thread";

    VSBsdInfo info;
    ASSERT_EQ(platform.pid_bsd_info(child.pid(), info), static_cast<int32_t>(sizeof info));
    EXPECT_EQ(info.ppid, static_cast<uint32_t>(getpid()));
    EXPECT_EQ(platform.pid_bsd_info(0x3FFFFFFF, info), 0) << "above pid_max: no such process";

    std::string area(64 * 1024, '\0');
    size_t length = 0;
    ASSERT_EQ(platform.process_argument_area(child.pid(), std::span<char>(area.data(), area.size()), length), 0);
    area.resize(length);
    uint32_t argc = 0;
    std::memcpy(&argc, area.data(), sizeof argc);
    EXPECT_EQ(argc, 3u);
    EXPECT_NE(area.find(std::string("anon:a:16:16\0thread:t", 22)), std::string::npos);
    ASSERT_EQ(platform.process_argument_area(child.pid(), std::span<char>(area.data(), 10), length), 0);
    EXPECT_EQ(length, 10u) << "a short buffer takes the beginning";
}

TEST_F(LinuxProcessTest, SmapsLargerThanTheFirstReadIsReadWhole) {
    // 600 one-page mappings of alternating protection, fenced by no-access
    // pages, print far more smaps text than the first read takes.
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
    std::vector<WalkedRegion> regions;
    EXPECT_EQ(walk(platform, taskFor(getpid()), regions), vs::kReturnNoMoreRegions);
    size_t found = 0;
    for (size_t i = 0; i < kMappings; ++i) {
        const uint64_t address = reinterpret_cast<uint64_t>(base + i * kPage);
        const WalkedRegion *r = containing(regions, address);
        if (r != nullptr && r->start == address && r->size == kPage) {
            ++found;
            EXPECT_EQ(r->info.residentPages, i % 2 == 0 ? 1u : 0u) << i;
        }
    }
    EXPECT_EQ(found, kMappings);
    munmap(outer, (kMappings + 2) * kPage);
}

} // namespace
