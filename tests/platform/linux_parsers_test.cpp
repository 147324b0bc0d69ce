// The text parsers of the Linux layer on small raw samples.

#include "targets/platform/linux/proc_reader.h"
#include "targets/platform/linux/proc_text.h"
#include "targets/platform/linux/smaps_parser.h"

#include <gtest/gtest.h>
#include <cstdio>
#include <tuple>
#include <sstream>
#include <string>
#include <string_view>

namespace {

using vs::SmapsRegion;

// What the region records are built from, one line per mapping.
std::string summary(const SmapsRegion &r) {
    std::ostringstream out;
    out << std::hex << r.start << '-' << r.end << " @" << r.offset << ' ' << r.devMajor << ':' << r.devMinor
        << std::dec << ' ' << r.inode << ' ' << (r.read ? 'r' : '-') << (r.write ? 'w' : '-')
        << (r.shared ? 's' : 'p') << " '" << r.path.str() << "' rss " << r.rss / 1024 << " pd " << r.privateDirty / 1024
        << " sd " << r.sharedDirty / 1024 << " lazy " << r.lazyFree / 1024 << " swap " << r.swap / 1024 << " [";
    const std::pair<uint64_t, const char *> flags[] = {{vs::kVmRead, "rd"},     {vs::kVmWrite, "wr"},
                                                       {vs::kVmMayRead, "mr"},  {vs::kVmMayWrite, "mw"},
                                                       {vs::kVmMayExec, "me"},  {vs::kVmGrowsDown, "gd"},
                                                       {vs::kVmLocked, "lo"},   {vs::kVmDontCopy, "dc"}};
    for (const auto &[bit, name] : flags) {
        out << (r.hasFlag(bit) ? name : "");
    }
    out << (r.hasVmFlags ? "]" : "none]");
    return out.str();
}

std::string parsed(bool stat, std::string_view text) {
    std::string result;
    if (stat) {
        const auto st = vs::parseStat(text);
        if (st) {
            result = "'" + st->comm + "' " + st->state + " ppid " + std::to_string(st->ppid) + " threads " +
                     std::to_string(st->numThreads) + " start " + std::to_string(st->startTime) +
                     ((st->flags & vs::kLinuxKernelThreadFlag) ? " kthread" : "") +
                     (vs::statSaysGone(*st) ? " gone" : "");
        }
        return result;
    }
    std::vector<SmapsRegion> regions;
    const size_t count = vs::parseSmaps(text, regions);
    EXPECT_EQ(count, regions.size());
    for (const SmapsRegion &r : regions) {
        result += (result.empty() ? "" : " | ") + summary(r);
    }
    return result;
}

TEST(LinuxProcText, SmapsAndStatEdgeCases) {
    struct Case {
        const char *what;
        bool stat; // else smaps
        std::string_view text;
        const char *expected;
    };
    const Case cases[] = {
        {"smaps: blanks and the deleted marker belong to the path; hex device numbers", false,
         "55fbb5e1c000-55fbb5e1e000 r--p 00002000 fe:00 247134          /usr/bin/my prog (deleted)\n"
         "Size:  8 kB\nRss:  8 kB\nPss:  4 kB\nShared_Clean:  4 kB\nPrivate_Clean:  4 kB\nVmFlags: rd mr mw me dw\n"
         "7ffdd96c5000-7ffdd96e6000 rw-s 00000000 103:0a 12        [stack]\nRss: 132 kB\nShared_Dirty: 12 kB\n"
         "Private_Dirty: 120 kB\nLazyFree: 8 kB\nSwap: 16 kB\nLocked: 132 kB\nVmFlags: rd wr mr mw me gd ac lo dc\n",
         "55fbb5e1c000-55fbb5e1e000 @2000 fe:0 247134 r-p '/usr/bin/my prog (deleted)' rss 8 pd 0 sd 0 lazy 0 swap 0 "
         "[rdmrmwme] | 7ffdd96c5000-7ffdd96e6000 @0 103:a 12 rws '[stack]' rss 132 pd 120 sd 12 lazy 8 swap 16 "
         "[rdwrmrmwmegdlodc]"},
        {"smaps: a zombie's is empty", false, "", ""},
        {"smaps: a read stopped inside a number does not make 13 kB", false,
         "400000-401000 r-xp 0 08:01 5 /bin/x\nRss:   4 kB\nSwap:   13",
         "400000-401000 @0 8:1 5 r-p '/bin/x' rss 4 pd 0 sd 0 lazy 0 swap 0 [none]"},
        {"smaps: a read stopped inside the next header", false,
         "400000-401000 r-xp 0 08:01 5 /bin/x\nRss:   4 kB\nVmFlags: rd\n00401000-0040",
         "400000-401000 @0 8:1 5 r-p '/bin/x' rss 4 pd 0 sd 0 lazy 0 swap 0 [rd]"},
        {"smaps: anonymous, with the trailing blank the kernel prints", false,
         "7f0000000000-7f0000002000 rw-p 00000000 00:00 0 \nRss: 8 kB\n",
         "7f0000000000-7f0000002000 @0 0:0 0 rwp '' rss 8 pd 0 sd 0 lazy 0 swap 0 [none]"},
        {"maps lines only", false, "400000-401000 r-xp 0 08:01 5 /bin/x\n401000-402000 rw-p 1000 08:01 5 /bin/x\n",
         "400000-401000 @0 8:1 5 r-p '/bin/x' rss 0 pd 0 sd 0 lazy 0 swap 0 [none] | "
         "401000-402000 @1000 8:1 5 rwp '/bin/x' rss 0 pd 0 sd 0 lazy 0 swap 0 [none]"},
        {"smaps: noise before the first header and unknown fields are skipped", false,
         "junk line\nRss: 4 kB\n400000-401000 ---p 0 00:00 0\nNewField: 9 kB\nRss: 0 kB\n",
         "400000-401000 @0 0:0 0 --p '' rss 0 pd 0 sd 0 lazy 0 swap 0 [none]"},
        {"smaps: an end below the start is no region", false, "402000-401000 r-xp 0 08:01 5 /bin/x\n", ""},
        {"stat: plain", true, "6276 (cat) R 6271 6271 3942 0 -1 4194304 101 0 1 0 0 0 0 0 20 0 1 0 32538 3133440 412\n",
         "'cat' R ppid 6271 threads 1 start 32538"},
        {"stat: blanks and parentheses in the name", true,
         "42 (a) b (c)) S 1 42 42 0 -1 4194560 1 0 0 0 0 0 0 0 20 0 3 0 5 0 0\n",
         "'a) b (c)' S ppid 1 threads 3 start 5"},
        {"stat: kernel thread", true, "2 (kthreadd) S 0 0 0 0 -1 2129984 0 0 0 0 0 0 0 0 20 0 1 0 1 0 0\n",
         "'kthreadd' S ppid 0 threads 1 start 1 kthread"},
        {"stat: zombie", true, "77 (ex it) Z 76 76 1 0 -1 4227084 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0\n",
         "'ex it' Z ppid 76 threads 1 start 9 gone"},
        // SIGKILLed with 3 GiB: for a while it still runs, tearing its memory down.
        {"stat: exiting", true, "78 (big) R 1 78 78 0 -1 4194628 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0\n",
         "'big' R ppid 1 threads 1 start 9 gone"},
        {"stat: empty name, no newline", true, "8 () S 1 8 8 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 9 0 0",
         "'' S ppid 1 threads 1 start 9"},
        {"stat: cut before the start time", true, "5 (x) S 1 5 5 0 -1 0 0 0 0 0 0 0 0 0 20 0 2 0",
         "'x' S ppid 1 threads 2 start 0"},
        {"stat: the lowest signed pid, whose negation overflows", true,
         "-9223372036854775808 (x) S 1 5 5 0 -1 0 0 0 0 0 0 0 0 0 20 0 2 0 7\n", "'x' S ppid 1 threads 2 start 7"},
        {"stat: a parent pid out of range", true, "5 (x) S -9223372036854775809 5 5 0 -1 0\n", ""},
        {"stat: cut after the name", true, "9 (x)", ""},
        {"stat: no parentheses", true, "9 x S 1", ""},
        {"stat: empty", true, "", ""},
    };
    for (const Case &c : cases) {
        EXPECT_EQ(parsed(c.stat, c.text), c.expected) << c.what;
    }
}

// The mount table tells tmpfs files (shmem) apart, and which file systems a header probe may open: never one whose
// server may not answer.
TEST(LinuxProcText, MappingKinds) {
    std::vector<uint64_t> tmpfs;
    std::vector<std::string> probed;
    for (const vs::MountDevice &mount : vs::parseMountDevices("22 1 254:0 / / rw - ext4 /dev/vda rw\n"
                                                              "40 22 0:45 / /run/a\\040b rw - tmpfs none rw\n"
                                                              "41 22 0:46 / /mnt/n rw - nfs4 srv:/x rw\n"
                                                              "42 22 0:47 / /mnt/s rw - fuse.sshfs u@h: rw\n"
                                                              "43 22 0:48 / /mnt/f rw - fuseblk /dev/sdb1 rw\n"
                                                              "44 22 7:0 / /snap/a rw - squashfs /dev/loop0 ro\n")) {
        if (mount.type == "tmpfs") {
            tmpfs.push_back(mount.device);
        }
        if (vs::mayProbeFileSystem(mount.type)) {
            probed.push_back(mount.type);
        }
    }
    ASSERT_EQ(tmpfs, std::vector<uint64_t>{45});
    EXPECT_EQ(probed, (std::vector<std::string>{"ext4", "tmpfs", "squashfs"}));
    const std::pair<const char *, vs::MappingKind> cases[] = {
        {"1000-2000 rw-p 00000000 00:00 0 ", vs::MappingKind::Anonymous},
        {"1000-2000 r--p 00000000 00:00 0 [vvar_vclock]", vs::MappingKind::Special},
        {"1000-2000 rw-s 00000000 00:01 1025 /dev/zero (deleted)", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:01 7 /memfd:jit (deleted)", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:2d 9 /run/a b/cache", vs::MappingKind::SharedMemory},
        {"1000-2000 rw-s 00000000 00:00 0 [anon_shmem:ring]", vs::MappingKind::SharedMemory},
        {"1000-2000 r--p 00000000 fe:00 5 /usr/lib/gone.so (deleted)", vs::MappingKind::File},
    };
    for (const auto &[header, kind] : cases) {
        std::vector<SmapsRegion> regions;
        ASSERT_EQ(vs::parseSmaps(std::string(header) + "\n", regions), 1u) << header;
        EXPECT_EQ(vs::mappingKind(regions[0], tmpfs), kind) << header;
    }
}

TEST(LinuxProcText, StatusAndThreadStackPointer) {
    constexpr std::string_view status = "Name:\tmy prog\nVmHWM:\t    1608 kB\nThreads:\t3\nRssAnonX:\t1 kB\n"
                                        "RssAnon:\t     108 kB";
    EXPECT_EQ(vs::statusValue(status, "Name").value_or("?"), "my prog");
    EXPECT_EQ(vs::statusBytes(status, "Threads"), 3u) << "a count without a unit stays a count";
    // A longer name with the same beginning is another line; the last line needs no newline.
    EXPECT_EQ(vs::statusBytes(status, "RssAnon"), 108u * 1024);
    EXPECT_FALSE(vs::statusBytes(status, "VmSwap").has_value());

    EXPECT_EQ(vs::parseSyscallStackPointer("0 0x3 0x7ffe1000 0x40 0x0 0x0 0x0 0x7ffd9a2c1e38 0x7f3b8e11a7e2\n"),
              0x7ffd9a2c1e38u);
    EXPECT_EQ(vs::parseSyscallStackPointer("-1 0x7f3b8d7fe9d0 0x7f3b8e0a1234\n"), 0x7f3b8d7fe9d0u);
    EXPECT_EQ(vs::parseSyscallStackPointer("running\n"), std::nullopt);
}

} // namespace

namespace {

// A parse held packed while it waits comes back exactly as it was.
TEST(LinuxProcText, PackedRegionsComeBackExactly) {
    const std::string text =
        "00400000-00452000 r-xp 00000000 fe:00 1234 /usr/bin/with space (deleted)\nRss: 328 kB\n"
        "Shared_Clean: 300 kB\nPrivate_Dirty: 28 kB\nLocked: 4 kB\nVmFlags: rd ex mr mw me dw\n"
        "00652000-00653000 rw-p 00052000 fe:00 1234 /usr/bin/with space (deleted)\nRss: 4 kB\n"
        "Anonymous: 4 kB\nSwap: 8 kB\nSwapPss: 4 kB\nLazyFree: 4 kB\n"
        "7f0000000000-7f0000400000 rw-s 00000000 00:10 77 /anon_hugepage (deleted)\nShared_Hugetlb: 2048 kB\n"
        "Private_Hugetlb: 2048 kB\nVmFlags: rd wr sh ht\n"
        "ffffffffff600000-ffffffffff601000 --xp 00000000 00:00 0 [vsyscall]\n";
    std::vector<vs::SmapsRegion> regions, back;
    ASSERT_EQ(vs::parseSmaps(text, regions), 4u);
    vs::unpackSmapsRegions(vs::packSmapsRegions(regions), back);
    ASSERT_EQ(back.size(), regions.size());
    for (size_t i = 0; i < regions.size(); ++i) {
        EXPECT_EQ(summary(back[i]), summary(regions[i])) << i;
        const auto fields = [](const vs::SmapsRegion &r) {
            return std::make_tuple(r.start, r.end, r.offset, r.inode, r.devMajor, r.devMinor, r.read, r.write, r.exec,
                                   r.shared, r.path, r.rss, r.sharedClean, r.sharedDirty, r.privateClean,
                                   r.privateDirty, r.lazyFree, r.anonymous, r.swap, r.swapPss, r.privateHugetlb,
                                   r.sharedHugetlb, r.locked, r.vmFlags, r.hasVmFlags);
        };
        EXPECT_TRUE(fields(back[i]) == fields(regions[i])) << i;
    }
    // Each path once, whatever number of mappings show it.
    EXPECT_EQ(vs::packSmapsRegions(regions).paths.size(), 3u);
}

// smaps read in pieces through a buffer that does not hold the file parses
// as the whole text does, wherever the reads cut it: inside a number, a
// header, a path longer than the buffer, or right at the end of a line.
TEST(LinuxProcText, SmapsReadInPiecesParsesAsTheWhole) {
    std::string text;
    for (int i = 0; i < 2000; ++i) {
        char header[96];
        std::snprintf(header, sizeof header, "%x000-%x000 rw-p %08x fe:00 %d ", 0x10000 + 2 * i, 0x10001 + 2 * i,
                      i * 4096, i % 3 == 0 ? 0 : 100 + i % 5);
        text += header;
        // One path much longer than the reader's buffer.
        text += i % 3 == 0 ? "" : i == 77 ? "/" + std::string(40000, 'x') : "/lib/piece" + std::to_string(i % 5);
        text += "\nSize: 4 kB\nRss: " + std::to_string(i % 7) + " kB\nPrivate_Dirty: " + std::to_string(i % 5) +
                " kB\nSwap: " + std::to_string(i) + " kB\nVmFlags: rd wr mr mw me ac\n";
    }
    text += "ffffffffff600000-ffffffffff601000 --xp 00000000 00:00 0 [vsyscall]\nRss: 12"; // cut short
    std::vector<SmapsRegion> whole;
    ASSERT_EQ(vs::parseSmaps(text, whole), 2001u);
    ASSERT_GT(text.size(), size_t{128 * 1024});

    std::FILE *file = std::tmpfile();
    ASSERT_NE(file, nullptr);
    ASSERT_EQ(std::fwrite(text.data(), 1, text.size(), file), text.size());
    ASSERT_EQ(std::fflush(file), 0);
    for (const size_t chunk : {size_t{1}, size_t{27}, size_t{3072}, SIZE_MAX}) {
        std::vector<SmapsRegion> pieces;
        vs::SmapsParser parser(pieces);
        uint64_t total = 0;
        size_t largest = 0;
        const int error = vs::readInPieces(fileno(file), chunk, [&](std::string_view piece) {
            largest = std::max(largest, piece.size());
            return parser.feed(piece);
        }, total);
        ASSERT_EQ(error, 0) << chunk;
        EXPECT_EQ(total, text.size()) << chunk;
        // Never more than the longest line and one read at a time.
        EXPECT_LE(largest, size_t{64 * 1024}) << chunk;
        ASSERT_EQ(pieces.size(), whole.size()) << chunk;
        for (size_t i = 0; i < whole.size(); ++i) {
            EXPECT_EQ(summary(pieces[i]), summary(whole[i])) << chunk << " mapping " << i;
        }
    }
    std::fclose(file);
}

} // namespace
