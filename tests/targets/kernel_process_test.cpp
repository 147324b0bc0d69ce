// The kernel target: zones, wired sites and counters as regions and "Maps" data; site names; refused queries.

#include <gtest/gtest.h>

#include <cstring>
#include <map>

#include "targets/kernel_process.h"
#include "tests/targets/target_test_support.h"

namespace {

constexpr uint64_t kTag = vs::kSiteTypeTag, kKext = vs::kSiteTypeKext, kCode = vs::kSiteTypeCodeAddress;
constexpr uint64_t kCounter = vs::kSiteTypeCounter, kWired = vs::kSiteFlagWired, kHidden = vs::kSiteFlagHidden;

class KernelProcessTest : public vs::testing::TargetTest {};

VSKernelSiteInfo site(uint64_t flags, uint64_t site, std::optional<uint16_t> zone = {},
                      std::optional<std::string> ownName = {}) {
    VSKernelSiteInfo info;
    info.flags = flags | (zone ? vs::kSiteFlagZoneShare : 0) | (ownName ? vs::kSiteFlagNamed : 0);
    info.site = site;
    info.zone = zone.value_or(0);
    const std::string name = ownName.value_or("");
    std::memcpy(info.name, name.data(), std::min(sizeof info.name, name.size()));
    return info;
}

std::map<std::string, int64_t> mapsOf(const VSProcess &process) {
    std::map<std::string, int64_t> values;
    auto maps = std::dynamic_pointer_cast<const VSAuxDataDictionary>(process.auxData()->objectForKey("Maps"));
    for (const auto &[key, node] : maps ? maps->entries() : VSAuxDataDictionary::Entries{}) {
        auto leaf = std::dynamic_pointer_cast<const VSAuxData>(node);
        values[key] = leaf && !leaf->shouldAggregate() ? leaf->value() : -1;
    }
    return values;
}

TEST_F(KernelProcessTest, SiteNamesFollowTypeTablesModulesSymbolsAndZones) {
    fake.kernel().kext("ext4", 3).kextWithoutBundleIdentifier("no-identifier", 9);
    fake.kernel().symbol(0xffffffff81000000, 0x100, "kernel_clone").symbol(0, 0x10, "at_zero");
    const auto kexts = VSKernelProcess::kextTags();
    const auto symbolicator = VSPlatform::current().kernel_symbolicator();
    const std::string eighty(80, 'z');
    const std::vector<std::string> zoneNames = {"zero", "one", "two", "kmalloc-64", eighty + "overflow"};
    std::vector<VSKernelZoneName> zones(zoneNames.size());
    for (size_t i = 0; i < zones.size(); ++i) {
        std::memcpy(zones[i].name, zoneNames[i].data(), std::min(sizeof zones[i].name, zoneNames[i].size()));
    }
    struct Case {
        VSKernelSiteInfo info;
        std::string expected;
        uint32_t zoneCount = 4;  // names passed; 0 for none
        bool withSymbolicator = true;
    };
    const std::vector<Case> cases = {
        {site(kTag, 13), "VM_KERN_MEMORY_KALLOC"}, {site(kTag, 28), "VM_KERN_MEMORY_FIRST_DYNAMIC"},
        {site(kTag, 29), "VM_KERN_MEMORY_29"}, {site(kTag, 255), "VM_KERN_MEMORY_ANY"},
        {site(kTag, 300), "VM_KERN_MEMORY_300"}, {site(kTag, 26), "VM_KERN_MEMORY_NET"},
        {site(kTag, 13, 3), "VM_KERN_MEMORY_KALLOC[kmalloc-64]"},
        {site(kTag, 13, 4), "VM_KERN_MEMORY_KALLOC"},  // zone index equal to the count
        {site(kTag, 13, 3), "VM_KERN_MEMORY_KALLOC", 0},
        {[] { auto info = site(kTag, 13); info.zone = 1; return info; }(), "VM_KERN_MEMORY_KALLOC"},  // no zone bit
        {site(kTag, 12, 4), "VM_KERN_MEMORY_ZONE[" + eighty + "]", 5},  // unterminated zone name
        {site(kKext, 3), "ext4"}, {site(kKext, 9), "unloaded kmod 9"},  // loaded, but without an identifier
        {site(kCode, 0xffffffff81000094), "kernel_clone"}, {site(kCode, 0x1234), "site 0x1234"},
        {site(kCode, 0), "site 0x0"},  // never looked up
        {site(kCode, 0xffffffff81000094), "site 0xffffffff81000094", 4, false},
        {site(kCounter, 6), "VM_KERN_COUNT_MAP_KERNEL"}, {site(kCounter, 10), "VM_KERN_COUNT_BOOT_STOLEN"},
        {site(kCounter, 11), "VM_KERN_COUNT_11"}, {site(7, 0x2a), "unknown site (0x7, 0x2a)"},
        {site(kCode, 0xffffffff81000094, {}, "vmap_stack"), "vmap_stack"},
        {site(kTag, 13, {}, eighty + "cut"), eighty},
        {site(kTag, 13, {}, "bad\xff"), "VM_KERN_MEMORY_KALLOC"},  // own name that is not text
        {site(kCounter, 2, {}, ""), ""}, {site(kTag, 1, 2, "mine"), "mine[two]"},
    };
    for (const Case &c : cases) {
        EXPECT_EQ(VSKernelProcess::_nameForWiredInfo(c.info, kexts, c.withSymbolicator ? symbolicator.get() : nullptr,
                                                     c.zoneCount ? zones.data() : nullptr, c.zoneCount),
                  c.expected);
    }
}

TEST_F(KernelProcessTest, RegionsFromZonesAndSites) {
    fake.kernel().zone("kmalloc-64", 10, 4096, 64, true).zone("task_struct", 3, 8192, 2048, false);
    fake.kernel().zone("overfull", 100, 4096, 64, true);  // a snapshot whose live part exceeds the zone
    fake.kernel().symbol(0x1200, 0x100, "vmalloc_caller").sourceLocation(0x1200, "mm/vmalloc.c", 42);
    // Site entries in order; the index is the region's user tag.
    fake.kernel().site(kTag | kWired, 12, 0x3000);            // 0
    fake.kernel().site(kTag | kWired, 24, 0x5000);            // 1: locked user pages
    fake.kernel().site(kTag, 8, 0x2000);                      // 2: not wired
    fake.kernel().site(kTag | kWired | kHidden, 9, 0x1000);   // 3
    fake.kernel().site(kTag, 0, 0);                           // 4: nothing at all: skipped
    fake.kernel().site(kTag | kWired, 0, 0x400);              // 5: site 0 with bytes
    fake.kernel().site(kCode | kWired, 0x1234, 0x6000);       // 6: code with a source file
    fake.kernel().site(kKext | kWired, 24, 0x2000);           // 7: a module numbered like the lock tag
    fake.kernel().site(kCounter | kWired, 6, 0x7000).mapped(0x1);  // 8: a wired counter is a region
    fake.kernel().site(9, 5, 0x100);                          // 9: unknown type
    fake.kernel().site(kTag | kWired, 13, 0x800).zone(0);     // 10: a zone's share
    // Counters that are not wired are "Maps" data: counter 0 only when something is mapped, the later of two
    // same-named ones, hidden or named ones too.
    for (auto [site, mapped] : std::vector<std::pair<uint64_t, uint64_t>>{{0, 0}, {2, 0}, {7, 10}, {7, 20}}) {
        fake.kernel().site(kCounter, site, 0x999).mapped(mapped);
    }
    fake.kernel().site(kCounter | kHidden, 11, 0).mapped(5);
    fake.kernel().site(kCounter, 1, 0).mapped(6).name("Unevictable");
    fake.kernelProcess();
    auto kernel = VSProcess::processWithPid(0);
    kernel->gatherData();
    EXPECT_TRUE(kernel->errors().empty());

    // Name, detailed name, object id, size, dirty, clean, reclaimable, wired, user tag.
    using Facts = std::tuple<std::string, std::optional<std::string>, uint64_t, uint64_t, uint64_t, uint64_t, uint64_t,
                             uint64_t, uint32_t>;
    const std::vector<Facts> expected = {
        {"kmalloc-64", "zone", 0x200000000, 4096, 640, 0, 3456, 0, 0},
        {"task_struct", "zone", 0x200000001, 8192, 8192, 0, 0, 0, 0},
        {"overfull", "zone", 0x200000002, 4096, 4096, 0, 0, 0, 0},
        {"VM_KERN_MEMORY_ZONE", {}, 0x30000000c, 0x3000, 0x3000, 0, 0, 0x3000, 0},
        {"VM_KERN_MEMORY_MLOCK", "(user wired)", 0x300000018, 0x5000, 0, 0x5000, 0, 0x5000, 1},
        {"VM_KERN_MEMORY_STACK", {}, 0x300000008, 0x2000, 0, 0x2000, 0, 0, 2},
        {"VM_KERN_MEMORY_CPU", "(hidden)", 0x300000009, 0x1000, 0, 0x1000, 0, 0x1000, 3},
        {"VM_KERN_MEMORY_NONE", {}, 0x300000000, 0x400, 0x400, 0, 0, 0x400, 5},
        {"vmalloc_caller", "(mm/vmalloc.c:42)", 0x100001234, 0x6000, 0x6000, 0, 0, 0x6000, 6},
        {"unloaded kmod 24", {}, 0x500000018, 0x2000, 0x2000, 0, 0, 0x2000, 7},
        {"VM_KERN_COUNT_MAP_KERNEL", {}, 0x400000006, 0x7000, 0x7000, 0, 0, 0x7000, 8},
        {"unknown site (0x9, 0x5)", {}, 0x100000005, 0x100, 0, 0x100, 0, 0, 9},
        {"VM_KERN_MEMORY_KALLOC[kmalloc-64]", {}, 0x30000000d, 0x800, 0, 0x800, 0, 0x800, 10},
    };
    const VSMemoryRegionList &regions = kernel->memoryRegions();
    ASSERT_EQ(regions.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        const VSMemoryRegion &r = *regions[i];
        EXPECT_EQ(Facts(r.name().value_or(""), r.detailedName(), r.object_id(), r.size(), r.dirtySize(),
                        r.cleanNonSpecSize(), r.reclaimableSize(), r.wiredSize(), r.user_tag()),
                  expected[i]);
    }
    EXPECT_EQ(mapsOf(*kernel), (std::map<std::string, int64_t>{
                                   {"VM_KERN_COUNT_WIRED", 0}, {"VM_KERN_COUNT_MAP_ZONE", 20}, {"VM_KERN_COUNT_11", 5},
                                   {"Unevictable", 6}}));
    // Each array goes back once: zone infos first, the names only after the sites were named, the sites last.
    std::vector<uint64_t> lengths;
    for (const VSFakeCall &call : fake.calls(VSFakeQuery::ReleaseMemory)) {
        lengths.push_back(call.length);
    }
    EXPECT_EQ(lengths, (std::vector<uint64_t>{3 * sizeof(VSKernelZoneInfo), 3 * sizeof(VSKernelZoneName),
                                              17 * sizeof(VSKernelSiteInfo)}));
    EXPECT_EQ(fake.outstandingKernelArrays(), 0u);
}

TEST_F(KernelProcessTest, ARefusedKernelQueryIsAnError) {
    fake.errorText(13, "Permission denied").failAlways(VSFakeQuery::KernelMemoryInfo, 13);
    fake.kernelProcess();
    auto kernel = VSProcess::processWithPid(0);
    ::testing::internal::CaptureStderr();
    kernel->gatherData();
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "kernel [0]: kernel_memory_info: Permission denied\n");
    EXPECT_EQ(kernel->errors(), std::vector<std::string>{"kernel [0]: Permission denied"});
    EXPECT_FALSE(kernel->hasMemoryRegions());
    EXPECT_EQ(mapsOf(*kernel), (std::map<std::string, int64_t>{}));  // reported even when unreadable
}

}  // namespace
