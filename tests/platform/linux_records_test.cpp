// How parsed mappings become region records (tags, share modes, object
// ids) and how ELF program headers become named image segments. What a
// real child process shows is checked in linux_process_test.cpp.

#include "model/memory_region.h"
#include "targets/platform/linux/elf_images.h"
#include "targets/platform/linux/object_ids.h"
#include "targets/platform/linux/region_records.h"
#include "targets/platform/linux/smaps_parser.h"

#include <algorithm>
#include <cstring>
#include <elf.h>
#include <gtest/gtest.h>
#include <optional>
#include <string>
#include <thread>
#include <tuple>

namespace {

using vs::SmapsRegion;

constexpr uint64_t kPage = 4096;

SmapsRegion parseOne(const std::string &text) {
    std::vector<SmapsRegion> regions;
    EXPECT_EQ(vs::parseSmaps(text, regions), 1u) << text;
    return regions.empty() ? SmapsRegion{} : regions[0];
}

TEST(LinuxRegionRecords, RecordFieldsFromSmaps) {
    struct Case {
        const char *what;
        std::string text;
        std::vector<uint64_t> stackPointers;
        uint32_t tag;
        uint8_t shareMode, externalPager;
        uint32_t inheritance;
        int32_t protection, maxProtection;
        uint64_t offset;
        uint32_t resident, swapped;
        uint16_t wired;
    };
    constexpr uint8_t kPrivate = vs::kShareModePrivate, kEmpty = vs::kShareModeEmpty, kShared = vs::kShareModeShared;
    constexpr uint32_t kCopy = vs::kInheritCopy, kShare = vs::kInheritShare;
    const Case cases[] = {
        {"a swapped-out region is not empty", "1000-9000 rw-p 0 00:00 0 \nSwap: 8 kB\nVmFlags: rd wr mr mw me\n", {},
         0, kPrivate, 0, kCopy, 3, 7, 0, 0, 2, 0},
        {"a file keeps its offset", "1000-4000 r--p 00002000 fe:00 99 /usr/lib/x.so\nRss: 12 kB\nVmFlags: rd mr mw me\n",
         {}, 0, kShared, 1, kCopy, 1, 7, 0x2000, 3, 0, 0},
        {"memfd keeps its offset", "1000-5000 rw-s 00003000 00:01 7 /memfd:x (deleted)\nRss: 4 kB\nVmFlags: rd wr sh\n",
         {}, vs::kTagMemfd, kShared, 0, kShare, 3, 0, 0x3000, 1, 0, 0},
        {"SysV segment", "1000-5000 rw-s 0 00:01 8 /SYSV00000001 (deleted)\nVmFlags: rd wr sh\n", {},
         vs::kTagSysVSharedMemory, kEmpty, 0, kShare, 3, 0, 0, 0, 0, 0},
        // 300000 locked pages do not fit the 16-bit count; Locked is not what counts.
        {"locked beyond the count", "0-100000000 rw-p 0 00:00 0 \nRss: 1200000 kB\nLocked: 4 kB\nVmFlags: rd wr lo\n",
         {}, 0, kPrivate, 0, kCopy, 3, 0, 0, 300000, 0, 0xFFFF},
        {"a thread's stack holds its stack pointer", "1000-9000 rw-p 0 00:00 0 \nRss: 8 kB\nVmFlags: rd wr\n",
         {0x500, 0x8ff8, 0x20000}, vs::kTagStack, kPrivate, 0, kCopy, 3, 0, 0, 2, 0, 0},
        {"a stack pointer just past the end does not count", "1000-9000 rw-p 0 00:00 0 \nVmFlags: rd wr\n", {0x9000},
         0, kEmpty, 0, kCopy, 3, 0, 0, 0, 0, 0},
        {"main stack", "1000-9000 rw-p 0 00:00 0 [stack]\nVmFlags: rd wr mr mw me gd\n", {}, vs::kTagStack, kEmpty, 0,
         kCopy, 3, 7, 0, 0, 0, 0},
        {"brk area", "1000-9000 rw-p 0 00:00 0 [heap]\nVmFlags: rd wr\n", {}, vs::kTagSbrk, kEmpty, 0, kCopy, 3, 0, 0,
         0, 0, 0},
        // User-level threads run on malloc'd stacks: the heap stays the heap.
        {"a stack pointer in the brk area", "1000-9000 rw-p 0 00:00 0 [heap]\nVmFlags: rd wr\n", {0x2000},
         vs::kTagSbrk, kEmpty, 0, kCopy, 3, 0, 0, 0, 0, 0},
        {"a stack pointer in a file mapping", "1000-9000 rw-p 0 fe:00 99 /x\nVmFlags: rd wr\n", {0x2000}, 0, kEmpty,
         1, kCopy, 3, 0, 0, 0, 0, 0},
        {"hugetlb pages count though Rss leaves them out",
         "1000-401000 rw-p 0 00:10 77 /anon_hugepage (deleted)\nPrivate_Hugetlb: 4096 kB\nVmFlags: rd wr ht\n", {},
         vs::kTagHugetlb, kPrivate, 0, kCopy, 3, 0, 0, 1024, 0, 0},
        {"vdso is one object shared by every process",
         "1000-3000 r-xp 0 00:00 0 [vdso]\nRss: 8 kB\nShared_Clean: 8 kB\nVmFlags: rd ex mr mw me de\n", {},
         vs::kTagVdso, kShared, 0, kCopy, 5, 7, 0, 2, 0, 0},
        {"vsyscall", "1000-3000 --xp 0 00:00 0 [vsyscall]\nVmFlags: ex\n", {}, vs::kTagVsyscall, kEmpty, 0, kCopy, 4,
         0, 0, 0, 0, 0},
        {"not inherited by a child", "1000-3000 rw-p 0 00:00 0 \nVmFlags: rd wr mr mw me dc\n", {}, 0, kEmpty, 0,
         vs::kInheritNone, 3, 7, 0, 0, 0, 0},
        {"a file gap of a library is no guard", "1000-3000 ---p 001d3000 fe:00 99 /usr/lib/x.so\nVmFlags: mr mw me\n",
         {}, 0, kEmpty, 1, kCopy, 0, 7, 0x1d3000, 0, 0, 0},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const SmapsRegion region = parseOne(c.text);
        const vs::MappingKind kind = vs::mappingKind(region, {});
        vs::ObjectIdTable ids;
        const VSRegionInfo info =
            vs::regionPartsFor(region, kind, vs::userTagFor(region, kind, c.stackPointers), ids, kPage).at(0);
        EXPECT_EQ(info.userTag, c.tag);
        EXPECT_EQ(info.shareMode, c.shareMode);
        EXPECT_EQ(info.externalPager, c.externalPager);
        EXPECT_EQ(info.inheritance, c.inheritance);
        EXPECT_EQ(info.protection, c.protection);
        EXPECT_EQ(info.maxProtection, c.maxProtection);
        EXPECT_EQ(uint64_t{info.offset}, c.offset); // a copy: the record is packed
        EXPECT_EQ(info.residentPages, c.resident);
        EXPECT_EQ(info.swappedOutPages, c.swapped);
        EXPECT_EQ(info.userWiredCount, c.wired);
        const VSRegionBasicInfo basic = vs::basicInfoFor(region, kind, kPage);
        EXPECT_EQ(std::make_tuple(basic.protection, uint64_t{basic.offset}, basic.userWiredCount),
                  std::make_tuple(c.protection, c.offset, c.wired));
    }
}

TEST(LinuxRegionRecords, NamedAnonymousMemoryGetsItsOwnTag) {
    const std::pair<const char *, const char *> cases[] = {
        {"1000-2000 rw-p 00000000 00:00 0 [anon:glibc arena]", "glibc arena"},
        {"1000-2000 rw-s 00000000 00:00 0 [anon_shmem:ring]", "ring"},
        {"3000-4000 rw-p 00000000 00:00 0 [anon:odd]name]", "odd]name"},
    };
    for (const auto &[header, name] : cases) {
        const SmapsRegion region = parseOne(std::string(header) + "\n");
        const uint32_t tag = vs::userTagFor(region, vs::mappingKind(region, {}), {});
        EXPECT_GE(tag, vs::kFirstDynamicTag) << header;
        EXPECT_EQ(VSMemoryRegion::categoryNameForTag(tag).value_or("?"), name) << header;
        EXPECT_EQ(vs::userTagFor(region, vs::mappingKind(region, {}), {}), tag) << "the same name keeps its tag";
    }
}

// Part records wait for the walk packed; they must come back byte for byte.
void expectPackedComeBack(const std::vector<VSRegionInfo> &records) {
    std::vector<uint8_t> packed;
    for (const VSRegionInfo &record : records) {
        vs::packRegionInfo(record, packed);
    }
    size_t at = 0;
    for (size_t i = 0; i < records.size(); ++i) {
        const VSRegionInfo back = vs::unpackRegionInfo(packed, at);
        EXPECT_EQ(std::memcmp(&back, &records[i], sizeof back), 0) << "record " << i;
    }
    EXPECT_EQ(at, packed.size());
}

TEST(LinuxRegionRecords, PartsOfOneMappingEachInOneObject) {
    // What a part is: which object (by what it stands for), where in it,
    // and its pages.
    struct Part {
        std::string object; // stable identity, "own" for a fresh object, "set" for the shared set's
        uint64_t offset;
        uint32_t resident, dirty, swapped, reusable;
        uint8_t shareMode, externalPager;
    };
    struct Case {
        const char *what;
        std::string text;
        std::vector<vs::SharedAnonymousPart> shared;
        std::optional<vs::ObjectPages> objectPages;
        std::vector<Part> parts;
    };
    constexpr uint8_t kPrivate = vs::kShareModePrivate, kEmpty = vs::kShareModeEmpty, kShared = vs::kShareModeShared;
    const uint32_t kSetObject = 1000; // outside the ids a fresh table hands out here
    const Case cases[] = {
        {"anonymous memory: all dirty but what was given back",
         "1000-9000 rw-p 0 00:00 0 \nRss: 32 kB\nAnonymous: 32 kB\nPrivate_Dirty: 28 kB\nPrivate_Clean: 4 kB\n"
         "LazyFree: 4 kB\nSwap: 8 kB\nVmFlags: rd wr\n",
         {}, {}, {{"own", 0, 8, 7, 2, 1, kPrivate, 0}}},
        {"a private file mapping: page cache beside the copies",
         "1000-5000 rw-p 00001000 fe:00 99 /x\nRss: 16 kB\nAnonymous: 8 kB\nPrivate_Clean: 8 kB\n"
         "Private_Dirty: 8 kB\nVmFlags: rd wr\n",
         {}, {}, {{"file 254:0 inode 99 offset 4096", 0x1000, 2, 0, 0, 0, kShared, 1}, {"own", 0, 2, 2, 0, 0, kPrivate, 0}}},
        {"page cache dirtied by write() is the file's, mapped privately or not",
         "1000-5000 r--p 0 fe:00 99 /x\nRss: 8 kB\nShared_Dirty: 4 kB\nPrivate_Dirty: 4 kB\nVmFlags: rd\n", {}, {},
         {{"file 254:0 inode 99 offset 0", 0, 2, 2, 0, 0, kShared, 1}}},
        {"a private mapping of a shmem file: its copies are its own, its pages not droppable",
         "1000-5000 rw-p 0 00:01 12 /dev/shm/pool\nRss: 8 kB\nAnonymous: 4 kB\nShared_Clean: 4 kB\n"
         "Private_Dirty: 4 kB\nVmFlags: rd wr\n",
         {}, {}, {{"file 0:1 inode 12 offset 0", 0, 1, 0, 0, 0, kShared, 0}, {"own", 0, 1, 1, 0, 0, kPrivate, 0}}},
        {"anonymous pages shared after fork go to the set, where the layer placed them",
         "1000-9000 rw-p 0 00:00 0 \nRss: 24 kB\nAnonymous: 24 kB\nShared_Dirty: 20 kB\nPrivate_Dirty: 4 kB\n"
         "Swap: 8 kB\nSwapPss: 4 kB\nVmFlags: rd wr\n",
         {{kSetObject, 0x7000, 5, 1}}, {},
         {{"own", 0, 1, 1, 1, 0, kPrivate, 0}, {"set", 0x7000, 5, 5, 1, 0, kShared, 0}}},
        {"all shared: no own part",
         "1000-3000 rw-p 0 00:00 0 \nRss: 8 kB\nAnonymous: 8 kB\nShared_Dirty: 8 kB\nVmFlags: rd wr\n",
         {{kSetObject, 0, 2, 0}}, {}, {{"set", 0, 2, 2, 0, 0, kShared, 0}}},
        {"a shared mapping touched in parts counts the object's pages in its range",
         "1000-11000 rw-s 0 00:01 12 /dev/shm/pool\nRss: 16 kB\nShared_Dirty: 16 kB\nVmFlags: rd wr sh\n", {},
         vs::ObjectPages{16, 16}, {{"file 0:1 inode 12", 0, 16, 16, 0, 0, kShared, 0}}},
        {"nothing resident: one empty part", "1000-5000 rw-p 0 fe:00 99 /x\nVmFlags: rd wr\n", {}, {},
         {{"file 254:0 inode 99 offset 0", 0, 0, 0, 0, 0, kEmpty, 1}}},
        {"kernel pages are one object by name", "1000-3000 r-xp 0 00:00 0 [vdso]\nRss: 8 kB\nVmFlags: rd ex\n", {}, {},
         {{"kernel mapping [vdso]", 0, 2, 0, 0, 0, kShared, 0}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        vs::ObjectIdTable ids;
        const SmapsRegion region = parseOne(c.text);
        const vs::MappingKind kind = vs::mappingKind(region, {});
        const std::vector<VSRegionInfo> parts =
            vs::regionPartsFor(region, kind, 0, ids, kPage, c.shared, c.objectPages);
        ASSERT_EQ(parts.size(), c.parts.size());
        std::vector<uint32_t> objects;
        for (size_t i = 0; i < parts.size(); ++i) {
            const VSRegionInfo &got = parts[i];
            const Part &want = c.parts[i];
            SCOPED_TRACE(i);
            if (want.object == "set") {
                EXPECT_EQ(got.objectId, kSetObject);
            } else if (want.object == "own") {
                EXPECT_NE(got.objectId, 0u);
                EXPECT_EQ(ids.stableIdentity(got.objectId), std::nullopt);
            } else {
                EXPECT_EQ(ids.stableIdentity(got.objectId).value_or("none"), want.object);
            }
            objects.push_back(got.objectId);
            EXPECT_EQ(std::make_tuple(uint64_t{got.offset}, got.residentPages, got.dirtiedPages, got.swappedOutPages,
                                      got.reusablePages, got.shareMode, got.externalPager),
                      std::make_tuple(want.offset, want.resident, want.dirty, want.swapped, want.reusable,
                                      want.shareMode, want.externalPager));
        }
        std::sort(objects.begin(), objects.end());
        EXPECT_EQ(std::adjacent_find(objects.begin(), objects.end()), objects.end()) << "one object per part";
        expectPackedComeBack(parts);
    }
    // Every field at its widest, the signed ones negative.
    VSRegionInfo widest;
    std::memset(static_cast<void *>(&widest), 0xFF, sizeof widest);
    VSRegionInfo mixed;
    mixed.protection = -2;
    mixed.offset = 0x7FFFFFFFF000ull;
    mixed.objectId = 1u << 31;
    mixed.shadowDepth = 0x8000;
    expectPackedComeBack({widest, mixed, VSRegionInfo{}});
}

TEST(LinuxObjectIds, WhatMakesTwoMappingsOneObject) {
    vs::ObjectIdTable ids;
    auto id = [&](const char *header) {
        const SmapsRegion region = parseOne(std::string(header) + "\nRss: 4 kB\n");
        return vs::regionPartsFor(region, vs::mappingKind(region, {}), 0, ids, kPage).at(0).objectId;
    };
    const uint32_t libcText = id("1000-2000 r-xp 00026000 fe:00 332835 /usr/lib/libc.so.6");
    const uint32_t libcData = id("5000-6000 rw-p 001d3000 fe:00 332835 /usr/lib/libc.so.6");
    const uint32_t otherDevice = id("1000-2000 r-xp 00026000 fe:01 332835 /mnt/libc.so.6");
    const uint32_t shared = id("1000-2000 rw-s 00000000 00:01 1025 /dev/zero (deleted)");
    const uint32_t vdso = id("1000-2000 r-xp 00000000 00:00 0 [vdso]");
    const uint32_t vvar = id("5000-6000 r--p 00000000 00:00 0 [vvar]");
    const uint32_t anon = id("1000-2000 rw-p 00000000 00:00 0 ");
    EXPECT_EQ(id("7000-8000 r-xp 00026000 fe:00 332835 /usr/lib/libc.so.6"), libcText) << "same window";
    EXPECT_EQ(id("8000-9000 rw-s 00001000 00:01 1025 /dev/zero (deleted)"), shared) << "one shared object";
    EXPECT_EQ(id("3000-4000 r-xp 00000000 00:00 0 [vdso]"), vdso);
    const uint32_t anonAgain = id("1000-2000 rw-p 00000000 00:00 0 ");
    const uint32_t heap = id("1000-2000 rw-p 00000000 00:00 0 [heap]");
    // A SysV segment shows its id where other shmem shows an inode number:
    // segment 1025 is not the shared mapping above.
    const uint32_t segment = id("1000-2000 rw-s 00000000 00:01 1025 /SYSV00000000 (deleted)");
    EXPECT_EQ(id("4000-5000 rw-s 00000000 00:01 1025 /SYSV00000000 (deleted)"), segment);
    std::vector<uint32_t> distinct = {libcText, libcData, otherDevice, shared, vdso, vvar, anon, anonAgain, heap, segment};
    std::sort(distinct.begin(), distinct.end());
    EXPECT_EQ(distinct, (std::vector<uint32_t>{1, 2, 3, 4, 5, 6, 7, 8, 9, 10})) << "distinct, dense, never 0";
    EXPECT_EQ(ids.idForFrameSet(3, 0x1000), ids.idForFrameSet(3, 0x1000));
    EXPECT_NE(ids.idForFrameSet(3, 0x1000), ids.idForFrameSet(4, 0x1000));
    EXPECT_NE(ids.idForFrameSet(3, 0x1000), ids.idForFrameSet(3, 0x2000));
}

TEST(LinuxElfImages, SegmentsAndBias) {
    // libc on a test machine: the loads and relro its loader reported.
    vs::ElfProgramInfo info;
    info.is64bit = true;
    info.loads = {{0, 0, 0x25388, PF_R},
                  {0x26000, 0x26000, 0x1550fc, PF_R | PF_X},
                  {0x17c000, 0x17c000, 0x52c31, PF_R},
                  {0x1ce8d0, 0x1cf8d0, 0x12680, PF_R | PF_W}};
    info.relroVaddr = 0x1cf8d0;
    info.relroMemsz = 0x3730;
    const uint64_t bias = 0x7fd1dd21e000;
    // The writable load starts with relro, which the loader protects up to
    // the page below its end (0x1d3000); the rest, with .bss, is "__DATA".
    const std::vector<std::tuple<uint64_t, uint64_t, std::string>> expected = {
        {bias + 0, 0x25388, "__TEXT"},
        {bias + 0x26000, 0x1550fc, "__TEXT"},
        {bias + 0x17c000, 0x52c31, "__TEXT"},
        {bias + 0x1cf8d0, 0x1d3000 - 0x1cf8d0, "__DATA_CONST"},
        {bias + 0x1d3000, 0x1cf8d0 + 0x12680 - 0x1d3000, "__DATA"},
    };
    std::vector<std::tuple<uint64_t, uint64_t, std::string>> segments;
    for (const auto &s : vs::imageSegments(info, bias, kPage)) {
        segments.emplace_back(s.start, s.size, s.name);
    }
    EXPECT_EQ(segments, expected);

    const std::tuple<uint64_t, uint64_t, std::optional<uint64_t>> biases[] = {
        {bias, 0, bias},                           // the header mapping
        {bias + 0x1cf000, 0x1ce000, bias},         // data: offset and vaddr differ by a page
        {bias + 0x1d0000, 0x1cf000, std::nullopt}, // no load starts there
    };
    for (const auto &[start, offset, expectedBias] : biases) {
        EXPECT_EQ(vs::loadBias(info, start, offset, kPage), expectedBias) << std::hex << offset;
    }
}

TEST(LinuxElfImages, ProgramHeaderParsing) {
    auto phdr = [](uint32_t type, uint64_t vaddr, uint64_t memsz, uint32_t flags) {
        const Elf64_Phdr ph{type, flags, 0, vaddr, 0, 0, memsz, 0};
        return std::string(reinterpret_cast<const char *>(&ph), sizeof ph);
    };
    Elf64_Ehdr header{};
    std::memcpy(header.e_ident, ELFMAG, SELFMAG);
    header.e_ident[EI_CLASS] = ELFCLASS64;
    header.e_ident[EI_DATA] = ELFDATA2LSB;
    header.e_phoff = sizeof header;
    header.e_phentsize = sizeof(Elf64_Phdr);
    header.e_phnum = 3;
    const std::string image = std::string(reinterpret_cast<const char *>(&header), sizeof header) +
                              phdr(PT_LOAD, 0x401000, 0x200, PF_R | PF_X) + phdr(PT_GNU_RELRO, 0x402000, 0x100, PF_R) +
                              phdr(PT_LOAD, 0x400000, 0x100, PF_R);
    const uint64_t whole = sizeof header + 3 * sizeof(Elf64_Phdr);
    uint64_t needed = 0;
    const auto info = vs::parseElfProgramHeaders(image, needed);
    ASSERT_TRUE(info.has_value());
    EXPECT_EQ(needed, whole);
    ASSERT_EQ(info->loads.size(), 2u);
    EXPECT_EQ(info->loads[0].vaddr, 0x400000u) << "loads are sorted by address";
    EXPECT_EQ(info->relroVaddr, 0x402000u);

    // A load claiming the top of the address space belongs to no process and is dropped.
    Elf64_Ehdr two = header;
    two.e_phnum = 2;
    const std::string wrapping = std::string(reinterpret_cast<const char *>(&two), sizeof two) +
                                 phdr(PT_LOAD, 0x400000, 0x100, PF_R) + phdr(PT_LOAD, UINT64_MAX - 0xfff, 0x2000, PF_R);
    const auto kept = vs::parseElfProgramHeaders(wrapping, needed);
    ASSERT_TRUE(kept.has_value());
    EXPECT_EQ(kept->loads.size(), 1u);

    // A header anyone may have written: a table offset near 2^64 must not wrap past the bounds check.
    auto withTableAt = [&](uint64_t offset) {
        Elf64_Ehdr crafted = header;
        crafted.e_phoff = offset;
        return std::string(reinterpret_cast<const char *>(&crafted), sizeof crafted) + image.substr(sizeof crafted);
    };
    const std::tuple<const char *, std::string, uint64_t> failures[] = {
        {"not ELF", "#!/bin/sh\necho hi\n" + std::string(64, ' '), 0},
        {"too short", image.substr(0, 10), 0},
        {"headers beyond the bytes read", image.substr(0, 100), whole},
        {"table offset wrapping around", withTableAt(UINT64_MAX - 63), UINT64_MAX},
        {"table offset past the end", withTableAt(image.size() + 8), image.size() + 8 + 3 * sizeof(Elf64_Phdr)},
    };
    for (const auto &[what, bytes, expectedNeeded] : failures) {
        EXPECT_FALSE(vs::parseElfProgramHeaders(bytes, needed).has_value()) << what;
        EXPECT_EQ(needed, expectedNeeded) << what;
    }
}

// Which files a process's images are read from, and what a failed read leaves behind. Only a file mapped executable
// somewhere can be an image: a data file is never read (opening one can start its writeback). A read that failed
// (the process went away meanwhile) must not mark the file "not an image" for every later process of the run.
TEST(LinuxElfImages, WhatIsReadForImages) {
    Elf64_Ehdr header{};
    std::memcpy(header.e_ident, ELFMAG, SELFMAG);
    header.e_ident[EI_CLASS] = ELFCLASS64;
    header.e_ident[EI_DATA] = ELFDATA2LSB;
    header.e_phoff = sizeof header;
    header.e_phentsize = sizeof(Elf64_Phdr);
    header.e_phnum = 2;
    const Elf64_Phdr loads[] = {{PT_LOAD, PF_R, 0, 0, 0, 0, 0x1000, 0},
                                {PT_LOAD, PF_R | PF_X, 0x1000, 0x1000, 0, 0, 0x1000, 0}};
    const std::string elf = std::string(reinterpret_cast<const char *>(&header), sizeof header) +
                            std::string(reinterpret_cast<const char *>(loads), sizeof loads);
    std::vector<SmapsRegion> regions;
    vs::parseSmaps("10000-11000 r--p 00000000 fe:00 7 /usr/lib/libx.so\n"
                   "11000-12000 r-xp 00001000 fe:00 7 /usr/lib/libx.so\n"
                   "20000-21000 r--p 00000000 fe:00 8 /srv/data.bin\n"
                   "30000-31000 rw-s 00000000 fe:00 9 /srv/shared.bin\n",
                   regions);

    struct Reads {
        std::vector<uint64_t> inodes;
        int failuresLeft = 0;
        std::string contents;
    } reads;
    auto read = [](void *context, const SmapsRegion &region, uint64_t offset, void *out, size_t size) -> int64_t {
        auto &r = *static_cast<Reads *>(context);
        r.inodes.push_back(region.inode);
        if (r.failuresLeft > 0) {
            --r.failuresLeft;
            return -ESRCH;
        }
        const size_t n = offset < r.contents.size() ? std::min(size, r.contents.size() - offset) : 0;
        std::memcpy(out, r.contents.data() + offset, n);
        return static_cast<int64_t>(n);
    };
    vs::ElfCache cache;
    const struct Step {
        const char *what;
        int failures;
        size_t images;
        std::vector<uint64_t> inodesRead;
    } steps[] = {
        {"the process goes away while libx is read (through either mapping)", 2, 0, {7, 7}},
        {"libx is read again, and only libx", 0, 1, {7}},
        {"the next process finds it in the cache", 0, 1, {}},
    };
    for (const Step &step : steps) {
        SCOPED_TRACE(step.what);
        reads.inodes.clear();
        reads.failuresLeft = step.failures;
        reads.contents = elf;
        const auto images = vs::processImages(regions, kPage, cache, read, &reads);
        EXPECT_EQ(images.size(), step.images);
        EXPECT_EQ(reads.inodes, step.inodesRead);
        if (!images.empty()) {
            EXPECT_EQ(images[0].path, "/usr/lib/libx.so");
            EXPECT_EQ(images[0].segments.size(), 2u);
        }
    }
}

} // namespace

namespace {

// Targets are walked on several workers at once, all asking one table: every
// key gets one id, however the askers interleave.
TEST(LinuxObjectIds, ManyWalkersAskingAtOnceGetOneIdPerKey) {
    vs::ObjectIdTable ids;
    constexpr int kKeys = 20000; // enough interleaving to break an unguarded table; ThreadSanitizer sees any race
    std::vector<std::vector<uint32_t>> seen(4);
    std::vector<std::thread> walkers;
    for (size_t w = 0; w < seen.size(); ++w) {
        walkers.emplace_back([&, w] {
            for (int k = 0; k < kKeys; ++k) {
                // Every walker asks for every key, in its own order.
                const int key = w % 2 == 0 ? k : kKeys - 1 - k;
                seen[w].push_back(ids.idForFileWindow(1, static_cast<uint64_t>(key), 0));
                (void)ids.freshId();
            }
        });
    }
    for (std::thread &walker : walkers) walker.join();
    for (size_t w = 1; w < seen.size(); ++w) {
        std::vector<uint32_t> mine = seen[w], first = seen[0];
        if (w % 2 == 1) std::reverse(mine.begin(), mine.end());
        EXPECT_EQ(mine, first) << "walker " << w;
    }
    std::vector<uint32_t> all = seen[0];
    std::sort(all.begin(), all.end());
    EXPECT_EQ(std::unique(all.begin(), all.end()), all.end()) << "one id per key";
    // Dense from 1: the keys' ids and the fresh ones together fill 1..n.
    EXPECT_EQ(ids.freshId(), static_cast<uint32_t>(kKeys + seen.size() * kKeys + 1));
}

} // namespace
