// The text parsers of the Linux layer on small raw samples and on a smaps
// capture of vs_memchild, whose memory was arranged as
//   anon:a:8:5 file:f:<3-page file> shared:s:4 mlock:m:3 free:fr:8:3
//   exec:e:2 none:n:2 thread:t
// (the addresses below are the ones it printed).

#include "targets/platform/linux/proc_reader.h"
#include "targets/platform/linux/proc_text.h"
#include "targets/platform/linux/smaps_parser.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <string>
#include <string_view>

namespace {

using vs::SmapsRegion;

std::string readData(const char *name) {
    const std::string path = std::string(VESTAGE_TEST_DATA_DIR) + "/" + name;
    std::string_view text;
    EXPECT_EQ(vs::readFileAt(AT_FDCWD, path.c_str(), text), 0) << path;
    return std::string(text);
}

const SmapsRegion *regionAt(const std::vector<SmapsRegion> &regions, uint64_t start) {
    for (const SmapsRegion &r : regions) {
        if (r.start == start) {
            return &r;
        }
    }
    return nullptr;
}

constexpr std::string_view kTwoRegions =
    "55fbb5e1c000-55fbb5e1e000 r--p 00002000 fe:00 247134                     /usr/bin/my prog (deleted)\n"
    "Size:                  8 kB\n"
    "KernelPageSize:        4 kB\n"
    "Rss:                   8 kB\n"
    "Pss:                   4 kB\n"
    "Shared_Clean:          4 kB\n"
    "Shared_Dirty:          0 kB\n"
    "Private_Clean:         4 kB\n"
    "Private_Dirty:         0 kB\n"
    "AnonHugePages:         0 kB\n"
    "FilePmdMapped:         0 kB\n"
    "Swap:                  0 kB\n"
    "SwapPss:               0 kB\n"
    "Locked:                0 kB\n"
    "VmFlags: rd mr mw me dw\n"
    "7ffdd96c5000-7ffdd96e6000 rw-s 00000000 103:0a 12                         [stack]\n"
    "Rss:                 132 kB\n"
    "Shared_Dirty:         12 kB\n"
    "Private_Dirty:       120 kB\n"
    "LazyFree:              8 kB\n"
    "Swap:                 16 kB\n"
    "Locked:              132 kB\n"
    "VmFlags: rd wr mr mw me gd ac lo dc\n";

TEST(LinuxSmapsParser, HeaderFieldsAndFlags) {
    std::vector<SmapsRegion> regions;
    ASSERT_EQ(vs::parseSmaps(kTwoRegions, regions), 2u);

    const SmapsRegion &file = regions[0];
    EXPECT_EQ(file.start, 0x55fbb5e1c000u);
    EXPECT_EQ(file.end, 0x55fbb5e1e000u);
    EXPECT_EQ(file.offset, 0x2000u);
    EXPECT_EQ(file.devMajor, 0xfeu);
    EXPECT_EQ(file.devMinor, 0u);
    EXPECT_EQ(file.inode, 247134u);
    EXPECT_TRUE(file.read);
    EXPECT_FALSE(file.write);
    EXPECT_FALSE(file.shared);
    // Blanks inside the path and the deleted marker belong to the path.
    EXPECT_EQ(file.path, "/usr/bin/my prog (deleted)");
    EXPECT_EQ(file.rss, 8u * 1024);
    EXPECT_EQ(file.sharedClean, 4u * 1024);
    EXPECT_EQ(file.privateClean, 4u * 1024);
    EXPECT_TRUE(file.hasFlag(vs::kVmMayRead | vs::kVmMayWrite | vs::kVmMayExec));
    EXPECT_FALSE(file.hasFlag(vs::kVmLocked));

    const SmapsRegion &stack = regions[1];
    EXPECT_EQ(stack.devMajor, 0x103u);
    EXPECT_EQ(stack.devMinor, 0x0au);
    EXPECT_TRUE(stack.shared);
    EXPECT_EQ(stack.path, "[stack]");
    EXPECT_EQ(stack.sharedDirty, 12u * 1024);
    EXPECT_EQ(stack.privateDirty, 120u * 1024);
    EXPECT_EQ(stack.lazyFree, 8u * 1024);
    EXPECT_EQ(stack.swap, 16u * 1024);
    EXPECT_EQ(stack.locked, 132u * 1024);
    for (uint64_t bit : {vs::kVmGrowsDown, vs::kVmLocked, vs::kVmDontCopy, vs::kVmAccount}) {
        EXPECT_TRUE(stack.hasFlag(bit)) << bit;
    }
    EXPECT_FALSE(stack.hasFlag(vs::kVmExec));
}

TEST(LinuxSmapsParser, DamagedAndShortInput) {
    struct Case {
        const char *what;
        std::string_view text;
        size_t regions;
        uint64_t lastRss; // of the last region
        bool lastHasFlags;
    };
    const Case cases[] = {
        // A zombie's smaps is empty.
        {"empty", "", 0, 0, false},
        // The read stopped inside a number: "Rss: 13" must not become 13 kB.
        {"cut inside a field",
         "00400000-00401000 r-xp 00000000 08:01 5 /bin/x\nRss:   4 kB\nSwap:   13", 1, 4096, false},
        // The read stopped inside the header of a second mapping.
        {"cut inside a header",
         "00400000-00401000 r-xp 00000000 08:01 5 /bin/x\nRss:   4 kB\nVmFlags: rd\n00401000-0040", 1,
         4096, true},
        // No path at all, with the trailing blank the kernel prints.
        {"anonymous", "7f0000000000-7f0000002000 rw-p 00000000 00:00 0 \nRss: 8 kB\n", 1, 8192, false},
        // maps lines only: regions without sizes.
        {"maps text",
         "00400000-00401000 r-xp 00000000 08:01 5 /bin/x\n00401000-00402000 rw-p 00001000 08:01 5 /bin/x\n",
         2, 0, false},
        // Garbage before the first header and an unknown field are skipped.
        {"noise", "junk line\nRss: 4 kB\n00400000-00401000 ---p 0 00:00 0\nNewField: 9 kB\nRss: 0 kB\n", 1,
         0, false},
        // A header whose end lies below its start is not a region.
        {"inverted", "00402000-00401000 r-xp 00000000 08:01 5 /bin/x\n", 0, 0, false},
    };
    for (const Case &c : cases) {
        std::vector<SmapsRegion> regions;
        EXPECT_EQ(vs::parseSmaps(c.text, regions), c.regions) << c.what;
        ASSERT_EQ(regions.size(), c.regions) << c.what;
        if (!regions.empty()) {
            EXPECT_EQ(regions.back().rss, c.lastRss) << c.what;
            EXPECT_EQ(regions.back().hasVmFlags, c.lastHasFlags) << c.what;
        }
    }
}

TEST(LinuxSmapsParser, RecordedCaptureOfArrangedChild) {
    const std::string text = readData("linux_smaps_memchild.txt");
    std::vector<SmapsRegion> regions;
    vs::parseSmaps(text, regions);
    ASSERT_EQ(regions.size(), 57u);
    for (size_t i = 1; i < regions.size(); ++i) {
        EXPECT_LE(regions[i - 1].end, regions[i].start) << "regions out of order at " << i;
        EXPECT_TRUE(regions[i].hasVmFlags) << i;
    }
    constexpr uint64_t kKiB = 1024;
    struct Expect {
        const char *label;
        uint64_t start;
        uint64_t size;
        uint64_t rss;
        uint64_t dirty; // private + shared
        uint64_t lazyFree;
        bool locked;
        bool shared;
        const char *path;
    };
    const Expect expected[] = {
        {"anon 8 pages, 5 written", 0x7f46321d5000, 0x8000, 20 * kKiB, 20 * kKiB, 0, false, false, ""},
        // Written just before the child mapped it: the page cache was still dirty.
        {"file of 3 pages, read", 0x7f46320cb000, 0x3000, 12 * kKiB, 12 * kKiB, 0, false, false,
         "/var/tmp/vs_capture_file"},
        {"shared anon, 4 written", 0x7f46320c7000, 0x4000, 16 * kKiB, 16 * kKiB, 0, false, true,
         "/dev/zero (deleted)"},
        {"mlocked 3 pages", 0x7f46320c3000, 0x3000, 12 * kKiB, 12 * kKiB, 0, true, false, ""},
        {"8 written, 3 freed", 0x7f46320b9000, 0x8000, 32 * kKiB, 20 * kKiB, 12 * kKiB, false, false, ""},
        {"no access", 0x7f46320b1000, 0x2000, 0, 0, 0, false, false, ""},
    };
    for (const Expect &e : expected) {
        const SmapsRegion *r = regionAt(regions, e.start);
        ASSERT_NE(r, nullptr) << e.label;
        EXPECT_EQ(r->size(), e.size) << e.label;
        EXPECT_EQ(r->rss, e.rss) << e.label;
        EXPECT_EQ(r->privateDirty + r->sharedDirty, e.dirty) << e.label;
        EXPECT_EQ(r->lazyFree, e.lazyFree) << e.label;
        EXPECT_EQ(r->hasFlag(vs::kVmLocked), e.locked) << e.label;
        EXPECT_EQ(r->shared, e.shared) << e.label;
        EXPECT_EQ(r->path, e.path) << e.label;
    }
}

TEST(LinuxSmapsParser, MappingKinds) {
    const std::vector<uint64_t> tmpfs = {(uint64_t{0} << 32) | 45};
    struct Case {
        const char *header;
        vs::MappingKind kind;
    };
    const Case cases[] = {
        {"1000-2000 rw-p 00000000 00:00 0 ", vs::MappingKind::Anonymous},
        {"1000-2000 rw-p 00000000 00:00 0 [heap]", vs::MappingKind::Anonymous},
        {"1000-2000 rw-p 00000000 00:00 0 [anon:arena]", vs::MappingKind::Anonymous},
        {"1000-2000 r-xp 00000000 00:00 0 [vdso]", vs::MappingKind::Special},
        {"1000-2000 r--p 00000000 00:00 0 [vvar_vclock]", vs::MappingKind::Special},
        {"1000-2000 --xp 00000000 00:00 0 [vsyscall]", vs::MappingKind::Special},
        {"1000-2000 rw-s 00000000 00:01 1025 /dev/zero (deleted)", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:01 7 /memfd:jit (deleted)", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:01 9 /SYSV00001234 (deleted)", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:1a 9 /dev/shm/queue", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:2d 9 /run/user/0/cache", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:00 0 [anon_shmem:ring]", vs::MappingKind::SharedMemory},
        {"1000-2000 r--p 00000000 fe:00 332835 /usr/lib/libc.so.6", vs::MappingKind::File},
        {"1000-2000 r--p 00000000 fe:00 5 /usr/lib/gone.so (deleted)", vs::MappingKind::File},
    };
    for (const Case &c : cases) {
        std::vector<SmapsRegion> regions;
        ASSERT_EQ(vs::parseSmaps(std::string(c.header) + "\n", regions), 1u) << c.header;
        EXPECT_EQ(vs::mappingKind(regions[0], tmpfs), c.kind) << c.header;
    }
}

TEST(LinuxProcText, StatCommandNames) {
    struct Case {
        const char *what;
        std::string_view text;
        bool ok;
        const char *comm;
        char state;
        int32_t ppid;
        uint64_t flags;
        uint64_t threads;
    };
    const Case cases[] = {
        {"plain",
         "6276 (cat) R 6271 6271 3942 0 -1 4194304 101 0 1 0 0 0 0 0 20 0 1 0 32538 3133440 412\n", true,
         "cat", 'R', 6271, 4194304, 1},
        {"blanks and parentheses in the name",
         "42 (a) b (c)) S 1 42 42 0 -1 4194560 1 0 0 0 0 0 0 0 20 0 3 0 5 0 0\n", true, "a) b (c)", 'S',
         1, 4194560, 3},
        {"kernel thread", "2 (kthreadd) S 0 0 0 0 -1 2129984 0 0 0 0 0 0 0 0 20 0 1 0 1 0 0\n", true,
         "kthreadd", 'S', 0, 2129984, 1},
        {"zombie", "77 (ex it) Z 76 76 1 0 -1 4227084 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0\n", true, "ex it", 'Z',
         76, 4227084, 1},
        {"empty name", "8 () S 1 8 8 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0", true, "", 'S', 1, 0, 1},
        {"cut after the name", "9 (x)", false, "", '?', 0, 0, 0},
        {"no parentheses", "9 x S 1", false, "", '?', 0, 0, 0},
        {"empty", "", false, "", '?', 0, 0, 0},
    };
    for (const Case &c : cases) {
        const auto st = vs::parseStat(c.text);
        ASSERT_EQ(st.has_value(), c.ok) << c.what;
        if (!st) {
            continue;
        }
        EXPECT_EQ(st->comm, c.comm) << c.what;
        EXPECT_EQ(st->state, c.state) << c.what;
        EXPECT_EQ(st->ppid, c.ppid) << c.what;
        EXPECT_EQ(st->flags, c.flags) << c.what;
        EXPECT_EQ(st->numThreads, c.threads) << c.what;
    }
    EXPECT_NE(vs::parseStat(cases[2].text)->flags & vs::kLinuxKernelThreadFlag, 0u);
    EXPECT_EQ(vs::parseStat(cases[0].text)->flags & vs::kLinuxKernelThreadFlag, 0u);
}

TEST(LinuxProcText, StatusSyscallMountinfoCmdline) {
    constexpr std::string_view status = "Name:\tmy prog\nVmHWM:\t    1608 kB\nVmPTE:\t      52 kB\n"
                                        "Threads:\t3\nRssAnonX:\t1 kB\nRssAnon:\t     108 kB";
    EXPECT_EQ(vs::statusValue(status, "Name").value_or("?"), "my prog");
    EXPECT_EQ(vs::statusBytes(status, "VmHWM"), 1608u * 1024);
    EXPECT_EQ(vs::statusBytes(status, "Threads"), 3u);
    // A longer name with the same beginning is another line; the last line
    // needs no newline.
    EXPECT_EQ(vs::statusBytes(status, "RssAnon"), 108u * 1024);
    EXPECT_FALSE(vs::statusBytes(status, "VmSwap").has_value());

    struct SyscallCase {
        std::string_view text;
        std::optional<uint64_t> sp;
    };
    const SyscallCase syscalls[] = {
        {"0 0x3 0x7ffe1000 0x40 0x0 0x0 0x0 0x7ffd9a2c1e38 0x7f3b8e11a7e2\n", 0x7ffd9a2c1e38},
        {"-1 0x7f3b8d7fe9d0 0x7f3b8e0a1234\n", 0x7f3b8d7fe9d0},
        {"running\n", std::nullopt},
        {"", std::nullopt},
        {"0 zz 0x1\n", std::nullopt},
    };
    for (const SyscallCase &c : syscalls) {
        EXPECT_EQ(vs::parseSyscallStackPointer(c.text), c.sp) << c.text;
    }

    constexpr std::string_view mountinfo =
        "22 1 254:0 / / rw,relatime shared:1 - ext4 /dev/vda rw\n"
        "36 22 0:22 / /dev/shm rw,nosuid,nodev shared:3 - tmpfs tmpfs rw\n"
        "40 22 0:33 / /run/a\\040b rw - tmpfs none rw,size=10k\n"
        "41 22 0:34 / /sys rw - sysfs sysfs rw\n";
    EXPECT_EQ(vs::parseTmpfsDevices(mountinfo), (std::vector<uint64_t>{22, 33}));

    struct ArgCase {
        std::string_view cmdline;
        uint32_t count;
    };
    const ArgCase args[] = {
        {std::string_view("a\0b c\0", 6), 2},
        {std::string_view("rewritten title", 15), 1},
        {"", 0},
        {std::string_view("\0\0", 2), 2},
    };
    for (const ArgCase &c : args) {
        EXPECT_EQ(vs::countArguments(c.cmdline), c.count);
    }
}

} // namespace
