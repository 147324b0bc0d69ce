// How parsed mappings become region records (tags, share modes, object
// ids) and how ELF program headers become named image segments.

#include "model/memory_region.h"
#include "targets/platform/linux/elf_images.h"
#include "targets/platform/linux/object_ids.h"
#include "targets/platform/linux/region_records.h"
#include "targets/platform/linux/smaps_parser.h"

#include <cstring>
#include <elf.h>
#include <gtest/gtest.h>
#include <string>
#include <thread>

namespace {

using vs::MappingKind;
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
        uint8_t shareMode;
        uint8_t externalPager;
        uint32_t inheritance;
        int32_t protection;
        int32_t maxProtection;
        uint64_t offset;
        uint32_t resident, dirtied, reusable, swapped;
        uint16_t wired;
    };
    const Case cases[] = {
        {"written anonymous memory is private",
         "1000-9000 rw-p 00000000 00:00 0 \nRss: 20 kB\nPrivate_Dirty: 20 kB\nVmFlags: rd wr mr mw me\n",
         {}, 0, vs::kShareModePrivate, 0, vs::kInheritCopy, 3, 7, 0, 5, 5, 0, 0, 0},
        {"untouched anonymous memory is empty", "1000-9000 rw-p 00000000 00:00 0 \nRss: 0 kB\nVmFlags: rd wr mr mw\n",
         {}, 0, vs::kShareModeEmpty, 0, vs::kInheritCopy, 3, 3, 0, 0, 0, 0, 0, 0},
        {"anonymous pages shared after fork are copy-on-write",
         "1000-9000 rw-p 00000000 00:00 0 \nRss: 8 kB\nShared_Dirty: 8 kB\nVmFlags: rd wr mr mw me\n", {}, 0,
         vs::kShareModeCopyOnWrite, 0, vs::kInheritCopy, 3, 7, 0, 2, 2, 0, 0, 0},
        {"a swapped-out region is not empty",
         "1000-9000 rw-p 00000000 00:00 0 \nRss: 0 kB\nSwap: 8 kB\nVmFlags: rd wr mr mw me\n", {}, 0,
         vs::kShareModePrivate, 0, vs::kInheritCopy, 3, 7, 0, 0, 0, 0, 2, 0},
        {"a read file keeps its offset and is copy-on-write",
         "1000-4000 r--p 00002000 fe:00 99 /usr/lib/x.so\nRss: 12 kB\nPrivate_Clean: 12 kB\nVmFlags: rd mr mw me\n",
         {}, 0, vs::kShareModeCopyOnWrite, 1, vs::kInheritCopy, 1, 7, 0x2000, 3, 0, 0, 0, 0},
        {"shared anonymous memory", "1000-5000 rw-s 00000000 00:01 1025 /dev/zero (deleted)\nRss: 16 kB\n"
         "Shared_Dirty: 16 kB\nVmFlags: rd wr sh mr mw me ms\n",
         {}, vs::kTagDevZero, vs::kShareModeShared, 0, vs::kInheritShare, 3, 7, 0, 4, 4, 0, 0, 0},
        {"memfd keeps its offset", "1000-5000 rw-s 00003000 00:01 7 /memfd:x (deleted)\nRss: 4 kB\nVmFlags: rd wr sh\n",
         {}, vs::kTagMemfd, vs::kShareModeShared, 0, vs::kInheritShare, 3, 0, 0x3000, 1, 0, 0, 0, 0},
        {"POSIX shared memory", "1000-5000 rw-s 00000000 00:16 7 /dev/shm/q\nVmFlags: rd wr sh\n", {},
         vs::kTagPosixSharedMemory, vs::kShareModeShared, 0, vs::kInheritShare, 3, 0, 0, 0, 0, 0, 0, 0},
        {"SysV segment", "1000-5000 rw-s 00000000 00:01 8 /SYSV00000001 (deleted)\nVmFlags: rd wr sh\n", {},
         vs::kTagSysVSharedMemory, vs::kShareModeShared, 0, vs::kInheritShare, 3, 0, 0, 0, 0, 0, 0, 0},
        {"locked pages are wired, whatever Locked says",
         "1000-4000 rw-p 00000000 00:00 0 \nRss: 12 kB\nPrivate_Dirty: 12 kB\nLocked: 4 kB\nVmFlags: rd wr mr mw me lo\n",
         {}, 0, vs::kShareModePrivate, 0, vs::kInheritCopy, 3, 7, 0, 3, 3, 0, 0, 3},
        {"MADV_FREE pages are reusable",
         "1000-9000 rw-p 00000000 00:00 0 \nRss: 32 kB\nPrivate_Clean: 12 kB\nPrivate_Dirty: 20 kB\n"
         "LazyFree: 12 kB\nVmFlags: rd wr mr mw me\n",
         {}, 0, vs::kShareModePrivate, 0, vs::kInheritCopy, 3, 7, 0, 8, 5, 3, 0, 0},
        {"no access anonymous memory is a guard", "1000-3000 ---p 00000000 00:00 0 \nVmFlags: mr mw me\n", {},
         vs::kTagGuard, vs::kShareModeEmpty, 0, vs::kInheritCopy, 0, 7, 0, 0, 0, 0, 0, 0},
        {"a thread's stack holds its stack pointer", "1000-9000 rw-p 00000000 00:00 0 \nRss: 8 kB\n"
         "Private_Dirty: 8 kB\nVmFlags: rd wr mr mw me\n",
         {0x500, 0x8ff8, 0x20000}, vs::kTagStack, vs::kShareModePrivate, 0, vs::kInheritCopy, 3, 7, 0, 2, 2, 0, 0, 0},
        {"a stack pointer just past the end does not count", "1000-9000 rw-p 00000000 00:00 0 \nVmFlags: rd wr\n",
         {0x9000}, 0, vs::kShareModeEmpty, 0, vs::kInheritCopy, 3, 0, 0, 0, 0, 0, 0, 0},
        {"main stack", "1000-9000 rw-p 00000000 00:00 0 [stack]\nVmFlags: rd wr mr mw me gd\n", {}, vs::kTagStack,
         vs::kShareModeEmpty, 0, vs::kInheritCopy, 3, 7, 0, 0, 0, 0, 0, 0},
        {"brk area", "1000-9000 rw-p 00000000 00:00 0 [heap]\nVmFlags: rd wr\n", {}, vs::kTagSbrk,
         vs::kShareModeEmpty, 0, vs::kInheritCopy, 3, 0, 0, 0, 0, 0, 0, 0},
        {"executable anonymous memory is JIT code", "1000-3000 r-xp 00000000 00:00 0 \nRss: 8 kB\n"
         "Private_Dirty: 8 kB\nVmFlags: rd ex mr mw me\n",
         {}, vs::kTagJitCode, vs::kShareModePrivate, 0, vs::kInheritCopy, 5, 7, 0, 2, 2, 0, 0, 0},
        {"vdso is one object shared by every process", "1000-3000 r-xp 00000000 00:00 0 [vdso]\nRss: 8 kB\n"
         "Shared_Clean: 8 kB\nVmFlags: rd ex mr mw me de\n", {},
         vs::kTagVdso, vs::kShareModeShared, 0, vs::kInheritCopy, 5, 7, 0, 2, 0, 0, 0, 0},
        {"vvar", "1000-3000 r--p 00000000 00:00 0 [vvar]\nVmFlags: rd mr pf io de dd\n", {}, vs::kTagVvar,
         vs::kShareModeShared, 0, vs::kInheritCopy, 1, 1, 0, 0, 0, 0, 0, 0},
        {"vsyscall", "1000-3000 --xp 00000000 00:00 0 [vsyscall]\nVmFlags: ex\n", {}, vs::kTagVsyscall,
         vs::kShareModeShared, 0, vs::kInheritCopy, 4, 0, 0, 0, 0, 0, 0, 0},
        {"not inherited by a child", "1000-3000 rw-p 00000000 00:00 0 \nVmFlags: rd wr mr mw me dc\n", {}, 0,
         vs::kShareModeEmpty, 0, vs::kInheritNone, 3, 7, 0, 0, 0, 0, 0, 0},
        {"a file gap of a library is no guard", "1000-3000 ---p 001d3000 fe:00 99 /usr/lib/x.so\nVmFlags: mr mw me\n",
         {}, 0, vs::kShareModeEmpty, 1, vs::kInheritCopy, 0, 7, 0x1d3000, 0, 0, 0, 0, 0},
    };
    for (const Case &c : cases) {
        const SmapsRegion region = parseOne(c.text);
        const MappingKind kind = vs::mappingKind(region, {});
        const uint32_t tag = vs::userTagFor(region, kind, c.stackPointers);
        const VSRegionInfo info = vs::regionInfoFor(region, kind, tag, 7, kPage);
        EXPECT_EQ(info.userTag, c.tag) << c.what;
        EXPECT_EQ(info.shareMode, c.shareMode) << c.what;
        EXPECT_EQ(info.externalPager, c.externalPager) << c.what;
        EXPECT_EQ(info.inheritance, c.inheritance) << c.what;
        EXPECT_EQ(info.protection, c.protection) << c.what;
        EXPECT_EQ(info.maxProtection, c.maxProtection) << c.what;
        EXPECT_EQ(info.offset, c.offset) << c.what;
        EXPECT_EQ(info.residentPages, c.resident) << c.what;
        EXPECT_EQ(info.dirtiedPages, c.dirtied) << c.what;
        EXPECT_EQ(info.reusablePages, c.reusable) << c.what;
        EXPECT_EQ(info.swappedOutPages, c.swapped) << c.what;
        EXPECT_EQ(info.userWiredCount, c.wired) << c.what;
        EXPECT_EQ(info.objectId, 7u) << c.what;
        EXPECT_EQ(info.isSubmap, 0) << c.what;

        const VSRegionBasicInfo basic = vs::basicInfoFor(region, kind, kPage);
        EXPECT_EQ(basic.protection, c.protection) << c.what;
        EXPECT_EQ(basic.offset, c.offset) << c.what;
        EXPECT_EQ(basic.shared, region.shared ? 1u : 0u) << c.what;
        EXPECT_EQ(basic.userWiredCount, c.wired) << c.what;
    }
}

TEST(LinuxRegionRecords, WiredCountIsCapped) {
    // 300000 locked pages do not fit the 16-bit count.
    const SmapsRegion region = parseOne("0-100000000 rw-p 00000000 00:00 0 \nRss: 1200000 kB\nVmFlags: rd wr lo\n");
    const VSRegionInfo info = vs::regionInfoFor(region, MappingKind::Anonymous, 0, 1, kPage);
    EXPECT_EQ(info.userWiredCount, 0xFFFF);
    EXPECT_EQ(info.residentPages, 300000u);
}

TEST(LinuxRegionRecords, NamedAnonymousMemoryGetsItsOwnTag) {
    struct Case {
        const char *header;
        const char *name;
    };
    const Case cases[] = {
        {"1000-2000 rw-p 00000000 00:00 0 [anon:glibc arena]", "glibc arena"},
        {"1000-2000 rw-s 00000000 00:00 0 [anon_shmem:ring]", "ring"},
        {"3000-4000 rw-p 00000000 00:00 0 [anon:odd]name]", "odd]name"},
    };
    for (const Case &c : cases) {
        const SmapsRegion region = parseOne(std::string(c.header) + "\n");
        const uint32_t tag = vs::userTagFor(region, vs::mappingKind(region, {}), {});
        EXPECT_GE(tag, vs::kFirstDynamicTag) << c.header;
        EXPECT_EQ(vs::dynamicTagName(tag).value_or("?"), c.name) << c.header;
        EXPECT_EQ(VSMemoryRegion::categoryNameForTag(tag).value_or("?"), c.name) << c.header;
        // The same name keeps its tag.
        EXPECT_EQ(vs::userTagFor(region, vs::mappingKind(region, {}), {}), tag) << c.header;
    }
}

TEST(LinuxObjectIds, OnePerFileOneNamePerKernelMappingFreshForAnonymous) {
    vs::ObjectIdTable ids;
    auto id = [&](const char *header) {
        const SmapsRegion region = parseOne(std::string(header) + "\n");
        return vs::objectIdFor(region, vs::mappingKind(region, {}), ids);
    };
    const uint32_t libcText = id("1000-2000 r-xp 00026000 fe:00 332835 /usr/lib/libc.so.6");
    const uint32_t libcData = id("5000-6000 rw-p 001d3000 fe:00 332835 /usr/lib/libc.so.6");
    const uint32_t otherDevice = id("1000-2000 r-xp 00000000 fe:01 332835 /mnt/libc.so.6");
    const uint32_t sharedA = id("1000-2000 rw-s 00000000 00:01 1025 /dev/zero (deleted)");
    const uint32_t sharedB = id("8000-9000 rw-s 00000000 00:01 1025 /dev/zero (deleted)");
    const uint32_t vdsoA = id("1000-2000 r-xp 00000000 00:00 0 [vdso]");
    const uint32_t vdsoB = id("3000-4000 r-xp 00000000 00:00 0 [vdso]");
    const uint32_t vvar = id("5000-6000 r--p 00000000 00:00 0 [vvar]");
    const uint32_t anonA = id("1000-2000 rw-p 00000000 00:00 0 ");
    const uint32_t anonB = id("1000-2000 rw-p 00000000 00:00 0 ");
    const uint32_t heap = id("1000-2000 rw-p 00000000 00:00 0 [heap]");

    EXPECT_EQ(libcText, libcData);
    EXPECT_NE(libcText, otherDevice);
    EXPECT_EQ(sharedA, sharedB);
    EXPECT_EQ(vdsoA, vdsoB);
    EXPECT_NE(vdsoA, vvar);
    EXPECT_NE(anonA, anonB);
    const std::vector<uint32_t> distinct = {libcText, otherDevice, sharedA, vdsoA, vvar, anonA, anonB, heap};
    for (size_t i = 0; i < distinct.size(); ++i) {
        EXPECT_NE(distinct[i], 0u);
        EXPECT_LE(distinct[i], 8u) << "ids are dense";
        for (size_t j = i + 1; j < distinct.size(); ++j) {
            EXPECT_NE(distinct[i], distinct[j]) << i << " " << j;
        }
    }
}

TEST(LinuxObjectIds, ConcurrentUseHandsOutEachIdOnce) {
    vs::ObjectIdTable ids;
    constexpr int kThreads = 4;
    constexpr int kPerThread = 2000;
    std::vector<std::vector<uint32_t>> fresh(kThreads);
    std::vector<uint32_t> fileIds(kThreads);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; ++i) {
                fresh[t].push_back(ids.freshId());
            }
            fileIds[t] = ids.idForFile(1, 2);
        });
    }
    for (std::thread &t : threads) {
        t.join();
    }
    std::vector<uint32_t> all;
    for (const auto &v : fresh) {
        all.insert(all.end(), v.begin(), v.end());
    }
    all.push_back(fileIds[0]);
    std::sort(all.begin(), all.end());
    EXPECT_EQ(std::adjacent_find(all.begin(), all.end()), all.end()) << "an id was handed out twice";
    EXPECT_EQ(all.front(), 1u);
    EXPECT_EQ(all.back(), static_cast<uint32_t>(kThreads * kPerThread + 1));
    for (uint32_t id : fileIds) {
        EXPECT_EQ(id, fileIds[0]);
    }
}

// libc on this machine: the loads and relro that its loader reported.
vs::ElfProgramInfo libcLike() {
    vs::ElfProgramInfo info;
    info.is64bit = true;
    info.loads = {{0, 0, 0x25388, PF_R},
                  {0x26000, 0x26000, 0x1550fc, PF_R | PF_X},
                  {0x17c000, 0x17c000, 0x52c31, PF_R},
                  {0x1ce8d0, 0x1cf8d0, 0x12680, PF_R | PF_W}};
    info.relroVaddr = 0x1cf8d0;
    info.relroMemsz = 0x3730;
    return info;
}

TEST(LinuxElfImages, SegmentsAndBias) {
    const vs::ElfProgramInfo info = libcLike();
    const uint64_t bias = 0x7fd1dd21e000;
    const auto segments = vs::imageSegments(info, bias, kPage);
    struct Expect {
        uint64_t start;
        uint64_t size;
        const char *name;
    };
    // The writable load starts with relro, which the loader protects up to
    // the page below its end (0x1d3000); the rest, with .bss, is "__DATA".
    const Expect expected[] = {
        {bias + 0, 0x25388, "__TEXT"},
        {bias + 0x26000, 0x1550fc, "__TEXT"},
        {bias + 0x17c000, 0x52c31, "__TEXT"},
        {bias + 0x1cf8d0, 0x1d3000 - 0x1cf8d0, "__DATA_CONST"},
        {bias + 0x1d3000, 0x1cf8d0 + 0x12680 - 0x1d3000, "__DATA"},
    };
    ASSERT_EQ(segments.size(), std::size(expected));
    for (size_t i = 0; i < segments.size(); ++i) {
        EXPECT_EQ(segments[i].start, expected[i].start) << i;
        EXPECT_EQ(segments[i].size, expected[i].size) << i;
        EXPECT_STREQ(segments[i].name, expected[i].name) << i;
    }

    struct BiasCase {
        uint64_t start;
        uint64_t offset;
        std::optional<uint64_t> bias;
    };
    const BiasCase biases[] = {
        {bias, 0, bias},                    // the header mapping
        {bias + 0x26000, 0x26000, bias},    // the code
        {bias + 0x1cf000, 0x1ce000, bias},  // data: offset and vaddr differ by a page
        {bias + 0x1d0000, 0x1cf000, std::nullopt}, // no load starts there
    };
    for (const BiasCase &c : biases) {
        EXPECT_EQ(vs::loadBias(info, c.start, c.offset, kPage), c.bias) << std::hex << c.offset;
    }

    // Without relro every writable load is "__DATA"; a non-executable image
    // mapped at its link address has bias 0.
    vs::ElfProgramInfo plain = info;
    plain.relroMemsz = 0;
    const auto plainSegments = vs::imageSegments(plain, 0, kPage);
    ASSERT_EQ(plainSegments.size(), 4u);
    EXPECT_STREQ(plainSegments[3].name, "__DATA");
    EXPECT_EQ(plainSegments[3].start, 0x1cf8d0u);
}

std::string elfHeader64(uint16_t phnum, uint64_t phoff) {
    Elf64_Ehdr header{};
    std::memcpy(header.e_ident, ELFMAG, SELFMAG);
    header.e_ident[EI_CLASS] = ELFCLASS64;
    header.e_ident[EI_DATA] = ELFDATA2LSB;
    header.e_phoff = phoff;
    header.e_phentsize = sizeof(Elf64_Phdr);
    header.e_phnum = phnum;
    std::string bytes(reinterpret_cast<const char *>(&header), sizeof header);
    bytes.resize(phoff, '\0');
    return bytes;
}

std::string phdr64(uint32_t type, uint64_t offset, uint64_t vaddr, uint64_t memsz, uint32_t flags) {
    Elf64_Phdr ph{};
    ph.p_type = type;
    ph.p_offset = offset;
    ph.p_vaddr = vaddr;
    ph.p_memsz = memsz;
    ph.p_flags = flags;
    return std::string(reinterpret_cast<const char *>(&ph), sizeof ph);
}

TEST(LinuxElfImages, ProgramHeaderParsing) {
    std::string image = elfHeader64(3, 64) + phdr64(PT_LOAD, 0x1000, 0x401000, 0x200, PF_R | PF_X) +
                        phdr64(PT_GNU_RELRO, 0x2000, 0x402000, 0x100, PF_R) +
                        phdr64(PT_LOAD, 0, 0x400000, 0x100, PF_R);
    uint64_t needed = 0;
    auto info = vs::parseElfProgramHeaders(image, needed);
    ASSERT_TRUE(info.has_value());
    EXPECT_TRUE(info->is64bit);
    EXPECT_EQ(needed, 64u + 3 * sizeof(Elf64_Phdr));
    ASSERT_EQ(info->loads.size(), 2u);
    EXPECT_EQ(info->loads[0].vaddr, 0x400000u) << "loads are sorted by address";
    EXPECT_EQ(info->loads[1].flags, static_cast<uint32_t>(PF_R | PF_X));
    EXPECT_EQ(info->relroVaddr, 0x402000u);
    EXPECT_EQ(info->relroMemsz, 0x100u);

    struct Case {
        const char *what;
        std::string bytes;
        uint64_t needed;
    };
    const Case failures[] = {
        {"not ELF", std::string("#!/bin/sh\necho hi\n") + std::string(64, ' '), 0},
        {"too short", image.substr(0, 10), 0},
        {"headers beyond the bytes read", image.substr(0, 100), 64 + 3 * sizeof(Elf64_Phdr)},
        {"no loadable segment", elfHeader64(1, 64) + phdr64(PT_NOTE, 0, 0, 0, 0), 64 + sizeof(Elf64_Phdr)},
    };
    for (const Case &c : failures) {
        EXPECT_FALSE(vs::parseElfProgramHeaders(c.bytes, needed).has_value()) << c.what;
        EXPECT_EQ(needed, c.needed) << c.what;
    }
}

TEST(LinuxElfImages, CacheReadsEachFileOnce) {
    vs::ElfCache cache;
    struct Source {
        std::string bytes;
        int reads = 0;
    };
    Source elf{elfHeader64(1, 64) + phdr64(PT_LOAD, 0, 0, 0x100, PF_R)};
    Source text{std::string(200, 'x')};
    auto reader = [](void *context, uint64_t offset, void *out, size_t size) -> int64_t {
        auto *source = static_cast<Source *>(context);
        ++source->reads;
        if (offset >= source->bytes.size()) {
            return 0;
        }
        const size_t n = std::min(size, source->bytes.size() - offset);
        std::memcpy(out, source->bytes.data() + offset, n);
        return static_cast<int64_t>(n);
    };
    for (int i = 0; i < 3; ++i) {
        EXPECT_NE(cache.lookup(1, 10, reader, &elf), nullptr);
        EXPECT_EQ(cache.lookup(1, 11, reader, &text), nullptr) << "not ELF, remembered as such";
    }
    EXPECT_EQ(elf.reads, 1);
    EXPECT_EQ(text.reads, 1);
}

} // namespace
