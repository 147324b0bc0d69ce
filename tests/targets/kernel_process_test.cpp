// The kernel target on the scripted platform: how zones, wired sites and
// counters become regions and "Maps" data, how site entries are named, and
// what a refused or failing kernel query leaves behind.

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "targets/kernel_process.h"
#include "tests/targets/target_test_support.h"

namespace {

using vs::testing::TargetTest;

constexpr uint64_t kTag = vs::kSiteTypeTag;
constexpr uint64_t kKext = vs::kSiteTypeKext;
constexpr uint64_t kCode = vs::kSiteTypeCodeAddress;
constexpr uint64_t kCounter = vs::kSiteTypeCounter;
constexpr uint64_t kWired = vs::kSiteFlagWired;
constexpr uint64_t kHidden = vs::kSiteFlagHidden;
constexpr uint64_t kNamed = vs::kSiteFlagNamed;
constexpr uint64_t kZoneShare = vs::kSiteFlagZoneShare;

class KernelProcessTest : public TargetTest {
protected:
    std::unique_ptr<VSKernelProcess> kernelTarget() {
        fake.kernelProcess();
        std::unique_ptr<VSProcess> process = VSProcess::processWithPid(0);
        auto *kernel = dynamic_cast<VSKernelProcess *>(process.get());
        if (kernel == nullptr) {
            return nullptr;
        }
        process.release();
        return std::unique_ptr<VSKernelProcess>(kernel);
    }
};

VSKernelZoneName zoneName(const std::string &text) {
    VSKernelZoneName name;
    std::memcpy(name.name, text.data(), std::min(sizeof name.name, text.size()));
    return name;
}

VSKernelSiteInfo siteInfo(uint64_t flags, uint64_t site, std::optional<uint16_t> zone = std::nullopt,
                          std::optional<std::string> ownName = std::nullopt) {
    VSKernelSiteInfo info;
    info.flags = flags;
    info.site = site;
    if (zone) {
        info.flags |= kZoneShare;
        info.zone = *zone;
    }
    if (ownName) {
        info.flags |= kNamed;
        std::memcpy(info.name, ownName->data(), std::min(sizeof info.name, ownName->size()));
    }
    return info;
}

std::map<std::string, int64_t> mapsOf(const VSProcess &process) {
    std::map<std::string, int64_t> values;
    auto aux = process.auxData();
    if (!aux) {
        return values;
    }
    auto maps = std::dynamic_pointer_cast<const VSAuxDataDictionary>(aux->objectForKey("Maps"));
    if (!maps) {
        values["<no Maps>"] = 0;
        return values;
    }
    for (const auto &[key, node] : maps->entries()) {
        auto leaf = std::dynamic_pointer_cast<const VSAuxData>(node);
        values[key] = leaf && !leaf->shouldAggregate() ? leaf->value() : -1;
    }
    return values;
}

TEST_F(KernelProcessTest, SiteNamesFollowTypeTablesModulesSymbolsAndZones) {
    fake.kernel()
        .kext("ext4", 3)
        .kextWithoutBundleIdentifier("no-identifier", 9)
        .symbol(0xffffffff81000000, 0x100, "kernel_clone")
        .symbol(0, 0x10, "at_zero");
    const auto kexts = VSKernelProcess::kextTags();
    const auto symbolicator = VSPlatform::current().kernel_symbolicator();
    ASSERT_NE(symbolicator, nullptr);

    const std::string eighty(80, 'z');
    const std::vector<VSKernelZoneName> zones = {zoneName("zero"), zoneName("one"), zoneName("two"),
                                                 zoneName("kmalloc-64"), zoneName(eighty + "overflow")};
    const uint32_t four = 4;  // only the first four names are passed in most cases

    struct Case {
        const char *what;
        VSKernelSiteInfo info;
        bool withZones;
        uint32_t zoneCount;
        bool withSymbolicator;
        std::string expected;
    };
    const std::vector<Case> cases = {
        {"tag in the table", siteInfo(kTag, 13), true, four, true, "VM_KERN_MEMORY_KALLOC"},
        {"tag 0", siteInfo(kTag, 0), true, four, true, "VM_KERN_MEMORY_NONE"},
        {"last fixed tag", siteInfo(kTag, 28), true, four, true, "VM_KERN_MEMORY_FIRST_DYNAMIC"},
        {"first dynamic tag", siteInfo(kTag, 29), true, four, true, "VM_KERN_MEMORY_29"},
        {"tag 40", siteInfo(kTag, 40), true, four, true, "VM_KERN_MEMORY_40"},
        {"tag 254", siteInfo(kTag, 254), true, four, true, "VM_KERN_MEMORY_254"},
        {"tag 255", siteInfo(kTag, 255), true, four, true, "VM_KERN_MEMORY_ANY"},
        {"tag 300, beyond the table", siteInfo(kTag, 300), true, four, true, "VM_KERN_MEMORY_300"},
        {"a Linux slot", siteInfo(kTag, 26), true, four, true, "VM_KERN_MEMORY_NET"},
        {"zone share", siteInfo(kTag, 13, 3), true, four, true, "VM_KERN_MEMORY_KALLOC[kmalloc-64]"},
        {"zone index equal to the count", siteInfo(kTag, 13, 4), true, four, true, "VM_KERN_MEMORY_KALLOC"},
        {"zone index far beyond", siteInfo(kTag, 13, 0xFFFF), true, four, true, "VM_KERN_MEMORY_KALLOC"},
        {"zone share without zone names", siteInfo(kTag, 13, 3), false, 0, true, "VM_KERN_MEMORY_KALLOC"},
        {"zone index without the zone bit",
         [] {
             VSKernelSiteInfo info = siteInfo(kTag, 13);
             info.zone = 1;
             return info;
         }(),
         true, four, true, "VM_KERN_MEMORY_KALLOC"},
        {"unterminated 80-byte zone name", siteInfo(kTag, 12, 4), true, 5, true, "VM_KERN_MEMORY_ZONE[" + eighty + "]"},
        {"loaded module", siteInfo(kKext, 3), true, four, true, "ext4"},
        {"module not loaded", siteInfo(kKext, 7), true, four, true, "unloaded kmod 7"},
        {"module without identifier", siteInfo(kKext, 9), true, four, true, "unloaded kmod 9"},
        {"code address inside a symbol", siteInfo(kCode, 0xffffffff81000094), true, four, true, "kernel_clone"},
        {"code address in no symbol", siteInfo(kCode, 0x1234), true, four, true, "site 0x1234"},
        {"code address 0 is never looked up", siteInfo(kCode, 0), true, four, true, "site 0x0"},
        {"no kernel symbolicator", siteInfo(kCode, 0xffffffff81000094), true, four, false, "site 0xffffffff81000094"},
        {"counter in the table", siteInfo(kCounter, 6), true, four, true, "VM_KERN_COUNT_MAP_KERNEL"},
        {"last counter", siteInfo(kCounter, 10), true, four, true, "VM_KERN_COUNT_BOOT_STOLEN"},
        {"counter beyond the table", siteInfo(kCounter, 11), true, four, true, "VM_KERN_COUNT_11"},
        {"unknown type", siteInfo(7, 0x2a), true, four, true, "unknown site (0x7, 0x2a)"},
        {"own name", siteInfo(kCode, 0xffffffff81000094, std::nullopt, "vmap_stack"), true, four, true, "vmap_stack"},
        {"own name of 80 bytes", siteInfo(kTag, 13, std::nullopt, eighty + "cut"), true, four, true, eighty},
        {"own name that is not text", siteInfo(kTag, 13, std::nullopt, "bad\xff"), true, four, true,
         "VM_KERN_MEMORY_KALLOC"},
        {"own name, empty", siteInfo(kCounter, 2, std::nullopt, ""), true, four, true, ""},
        {"own name and zone share", siteInfo(kTag, 1, 2, "mine"), true, four, true, "mine[two]"},
    };
    for (const Case &c : cases) {
        const std::string name = VSKernelProcess::_nameForWiredInfo(
            c.info, kexts, c.withSymbolicator ? symbolicator.get() : nullptr, c.withZones ? zones.data() : nullptr,
            c.zoneCount);
        EXPECT_EQ(name, c.expected) << c.what;
    }
}

TEST_F(KernelProcessTest, RegionsFromZonesAndSites) {
    fake.pageSize(4096);
    fake.kernel()
        .zone("kmalloc-64", 10, 4096, 64, true)
        .zone("task_struct", 3, 8192, 2048, false)
        .zone("overfull", 100, 4096, 64, true)  // a snapshot whose live part exceeds the zone
        .symbol(0x1200, 0x100, "vmalloc_caller")
        .sourceLocation(0x1200, "mm/vmalloc.c", 42)
        .symbol(0x5000, 0x100, "no_path")
        .sourceLocation(0x5000, std::nullopt, 7)
        .kext("ext4", 2);
    // Site entries in order; the index is the region's user tag.
    fake.kernel().site(kTag | kWired, 12, 0x3000);            // 0: dirty and wired
    fake.kernel().site(kTag | kWired, 24, 0x5000);            // 1: locked user pages
    fake.kernel().site(kTag, 8, 0x2000);                      // 2: not wired
    fake.kernel().site(kTag | kWired | kHidden, 9, 0x1000);   // 3: hidden
    fake.kernel().site(kTag | kWired, 13, 0x800).zone(0);     // 4: a zone's share
    fake.kernel().site(kTag, 0, 0);                           // 5: nothing at all: skipped
    fake.kernel().site(kTag | kWired, 0, 0x400);              // 6: site 0 with bytes
    fake.kernel().site(kCode | kWired, 0x1234, 0x6000);       // 7: code with a source file
    fake.kernel().site(kCode | kWired, 0x5010, 0x1000);       // 8: code, location without path
    fake.kernel().site(kKext | kWired, 2, 0x9000);            // 9: a module
    fake.kernel().site(kKext | kWired, 24, 0x2000);           // 10: a module numbered like the lock tag
    fake.kernel().site(kCounter | kWired, 6, 0x7000).mapped(0x1);  // 11: wired counter: a region
    fake.kernel().site(9, 5, 0x100);                          // 12: unknown type

    auto kernel = kernelTarget();
    ASSERT_NE(kernel, nullptr);
    kernel->gatherData();
    EXPECT_TRUE(kernel->errors().empty());
    ASSERT_TRUE(kernel->hasMemoryRegions());

    struct Expected {
        std::string name;
        std::optional<std::string> detail;
        uint64_t objectId, size, dirty, clean, reclaimable, wired;
        uint32_t userTag;
    };
    const std::vector<Expected> expected = {
        {"kmalloc-64", "zone", 0x200000000, 4096, 640, 0, 3456, 0, 0},
        {"task_struct", "zone", 0x200000001, 8192, 8192, 0, 0, 0, 0},
        {"overfull", "zone", 0x200000002, 4096, 4096, 0, 0, 0, 0},
        {"VM_KERN_MEMORY_ZONE", std::nullopt, 0x30000000c, 0x3000, 0x3000, 0, 0, 0x3000, 0},
        {"VM_KERN_MEMORY_MLOCK", "(user wired)", 0x300000018, 0x5000, 0, 0x5000, 0, 0x5000, 1},
        {"VM_KERN_MEMORY_STACK", std::nullopt, 0x300000008, 0x2000, 0, 0x2000, 0, 0, 2},
        {"VM_KERN_MEMORY_CPU", "(hidden)", 0x300000009, 0x1000, 0, 0x1000, 0, 0x1000, 3},
        {"VM_KERN_MEMORY_KALLOC[kmalloc-64]", std::nullopt, 0x30000000d, 0x800, 0, 0x800, 0, 0x800, 4},
        {"VM_KERN_MEMORY_NONE", std::nullopt, 0x300000000, 0x400, 0x400, 0, 0, 0x400, 6},
        {"vmalloc_caller", "(mm/vmalloc.c:42)", 0x100001234, 0x6000, 0x6000, 0, 0, 0x6000, 7},
        {"no_path", std::nullopt, 0x100005010, 0x1000, 0x1000, 0, 0, 0x1000, 8},
        {"ext4", std::nullopt, 0x500000002, 0x9000, 0x9000, 0, 0, 0x9000, 9},
        {"unloaded kmod 24", std::nullopt, 0x500000018, 0x2000, 0x2000, 0, 0, 0x2000, 10},
        {"VM_KERN_COUNT_MAP_KERNEL", std::nullopt, 0x400000006, 0x7000, 0x7000, 0, 0, 0x7000, 11},
        {"unknown site (0x9, 0x5)", std::nullopt, 0x100000005, 0x100, 0, 0x100, 0, 0, 12},
    };
    const VSMemoryRegionList &regions = kernel->memoryRegions();
    ASSERT_EQ(regions.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        const VSMemoryRegion &r = *regions[i];
        const Expected &e = expected[i];
        SCOPED_TRACE(e.name);
        EXPECT_EQ(r.name(), e.name);
        EXPECT_EQ(r.detailedName(), e.detail);
        EXPECT_EQ(r.object_id(), e.objectId);
        EXPECT_EQ(r.size(), e.size);
        EXPECT_EQ(r.dirtySize(), e.dirty);
        EXPECT_EQ(r.cleanNonSpecSize(), e.clean);
        EXPECT_EQ(r.reclaimableSize(), e.reclaimable);
        EXPECT_EQ(r.wiredSize(), e.wired);
        EXPECT_EQ(r.swappedSize(), 0u);
        EXPECT_EQ(r.user_tag(), e.userTag);
        EXPECT_EQ(r.start(), 0u);
        EXPECT_EQ(r.offset(), 0u);
        EXPECT_EQ(r.segment(), VSSegmentUnknown);
    }
    EXPECT_EQ(mapsOf(*kernel), (std::map<std::string, int64_t>{}));
    EXPECT_EQ(kernel->pageSize(), 4096u);
    EXPECT_EQ(kernel->idleExitStatus(), VSIdleExitUnsupported);
    EXPECT_TRUE(kernel->_isAlive());
}

TEST_F(KernelProcessTest, CountersBecomeMapsData) {
    struct Case {
        const char *what;
        std::function<void(VSFakePlatform &)> script;
        std::map<std::string, int64_t> maps;
        size_t regions;
    };
    const std::vector<Case> cases = {
        {"no counters: an empty Maps", [](VSFakePlatform &) {}, {}, 0},
        {"counter 6 with flags exactly 3",
         [](VSFakePlatform &f) { f.kernel().site(kCounter, 6, 0x999).mapped(0x7000); },
         {{"VM_KERN_COUNT_MAP_KERNEL", 0x7000}}, 0},
        {"counter 0 with nothing mapped is skipped",
         [](VSFakePlatform &f) { f.kernel().site(kCounter, 0, 0x999).mapped(0); }, {}, 0},
        {"counter 0 with bytes mapped",
         [](VSFakePlatform &f) { f.kernel().site(kCounter, 0, 0).mapped(0x100); },
         {{"VM_KERN_COUNT_MANAGED", 0x100}}, 0},
        {"counter with a site but nothing mapped",
         [](VSFakePlatform &f) { f.kernel().site(kCounter, 2, 0x999).mapped(0); },
         {{"VM_KERN_COUNT_WIRED", 0}}, 0},
        {"the later of two same-named counters wins",
         [](VSFakePlatform &f) {
             f.kernel().site(kCounter, 7, 0).mapped(10);
             f.kernel().site(kCounter, 7, 0).mapped(20);
         },
         {{"VM_KERN_COUNT_MAP_ZONE", 20}}, 0},
        {"a hidden or named counter is still a counter",
         [](VSFakePlatform &f) {
             f.kernel().site(kCounter | kHidden, 11, 0).mapped(5);
             f.kernel().site(kCounter, 1, 0).mapped(6).name("Unevictable");
         },
         {{"VM_KERN_COUNT_11", 5}, {"Unevictable", 6}}, 0},
        {"a wired counter is a region",
         [](VSFakePlatform &f) { f.kernel().site(kCounter | kWired, 6, 0x2000).mapped(0x7000); }, {}, 1},
        {"a zone's share of a counter is a region",
         [](VSFakePlatform &f) {
             f.kernel().zone("z", 0, 0, 8);
             f.kernel().site(kCounter, 6, 0x2000).zone(0);
         },
         {}, 2},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSFakePlatform local;
        local.errorStream(nullptr);
        auto installed = local.install();
        c.script(local);
        local.kernelProcess();
        auto process = VSProcess::processWithPid(0);
        ASSERT_NE(process, nullptr);
        process->gatherData();
        EXPECT_EQ(mapsOf(*process), c.maps);
        EXPECT_EQ(process->memoryRegions().size(), c.regions);
        EXPECT_EQ(local.outstandingKernelArrays(), 0u);
    }
}

TEST_F(KernelProcessTest, SitesAreNamedWhileTheZoneNamesAreStillHeld) {
    fake.kernel().zone("kmalloc-128", 1, 4096, 128).zone("dentry", 1, 4096, 192);
    fake.kernel().site(kTag | kWired, 13, 0x1000).zone(1);
    auto kernel = kernelTarget();
    ASSERT_NE(kernel, nullptr);
    kernel->gatherData();
    ASSERT_EQ(kernel->memoryRegions().size(), 3u);
    EXPECT_EQ(kernel->memoryRegions()[2]->name(), "VM_KERN_MEMORY_KALLOC[dentry]");

    // Each array goes back once, with its own length: zone infos first, the
    // names only after the sites were named, the sites last.
    const auto releases = fake.calls(VSFakeQuery::ReleaseMemory);
    ASSERT_EQ(releases.size(), 3u);
    EXPECT_EQ(releases[0].length, 2 * sizeof(VSKernelZoneInfo));
    EXPECT_EQ(releases[1].length, 2 * sizeof(VSKernelZoneName));
    EXPECT_EQ(releases[2].length, 1 * sizeof(VSKernelSiteInfo));
    for (const VSFakeCall &call : releases) {
        EXPECT_EQ(call.result, 0);
    }
    EXPECT_EQ(fake.outstandingKernelArrays(), 0u);
    // The symbolicator and the module list are asked once per gathering.
    EXPECT_EQ(fake.callCount(VSFakeQuery::KernelSymbolicator), 1u);
    EXPECT_EQ(fake.callCount(VSFakeQuery::LoadedKextInfo), 1u);
}

TEST_F(KernelProcessTest, FailuresOfTheKernelQueries) {
    struct Case {
        const char *what;
        std::function<void(VSFakePlatform &)> script;
        std::vector<std::string> errors;
        std::string stderrText;
        bool hasRegions;
        size_t regions;
        std::string siteName;
    };
    const std::vector<Case> cases = {
        {"kernel_memory_info refused",
         [](VSFakePlatform &f) {
             f.errorText(13, "Permission denied");
             f.failAlways(VSFakeQuery::KernelMemoryInfo, 13);
         },
         {"kernel [0]: Permission denied"}, "kernel [0]: kernel_memory_info: Permission denied\n", false, 0, ""},
        {"release_memory refused: three lines, no error",
         [](VSFakePlatform &f) {
             f.errorText(22, "Invalid argument");
             f.failAlways(VSFakeQuery::ReleaseMemory, 22);
         },
         {},
         "kernel [0]: release_memory: Invalid argument\n"
         "kernel [0]: release_memory: Invalid argument\n"
         "kernel [0]: release_memory: Invalid argument\n",
         true, 2, "f"},
        {"no symbolicator and no module list: fallback names, no error",
         [](VSFakePlatform &f) {
             f.failAlways(VSFakeQuery::KernelSymbolicator, 1);
             f.failAlways(VSFakeQuery::LoadedKextInfo, 1);
         },
         {}, "", true, 2, "site 0x1000"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        VSFakePlatform local;
        local.errorStream(nullptr);
        auto installed = local.install();
        local.kernel().zone("dentry", 1, 4096, 192);
        local.kernel().site(kCode | kWired, 0x1000, 0x2000);
        local.kernel().symbol(0x1000, 0x10, "f");
        c.script(local);
        local.kernelProcess();
        auto process = VSProcess::processWithPid(0);
        ASSERT_NE(process, nullptr);
        ::testing::internal::CaptureStderr();
        process->gatherData();
        EXPECT_EQ(::testing::internal::GetCapturedStderr(), c.stderrText);
        EXPECT_EQ(process->errors(), c.errors);
        EXPECT_TRUE(process->warnings().empty());
        EXPECT_EQ(process->hasMemoryRegions(), c.hasRegions);
        EXPECT_EQ(process->memoryRegions().size(), c.regions);
        if (c.regions == 2) {
            EXPECT_EQ(process->memoryRegions()[1]->name(), c.siteName);
        }
        // Even a kernel that could not be read reports its (empty) counters.
        EXPECT_EQ(mapsOf(*process), (std::map<std::string, int64_t>{}));
    }
}

}  // namespace
