#include "targets/kernel_process.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <string_view>
#include <utility>

#include "model/assert.h"

namespace {

// Kernel-site tag names. Slots 1, 3, 4, 5, 6 and 26 name parts of the
// Linux kernel; the others are the fixed, platform-neutral purposes.
constexpr std::array<const char *, 256> makeSiteTagTable() {
    std::array<const char *, 256> table{};
    table[0] = "VM_KERN_MEMORY_NONE";
    table[1] = "VM_KERN_MEMORY_MM";
    table[2] = "VM_KERN_MEMORY_BSD";
    table[3] = "VM_KERN_MEMORY_DRIVERS";
    table[4] = "VM_KERN_MEMORY_LIB";
    table[5] = "VM_KERN_MEMORY_MODULES";
    table[6] = "VM_KERN_MEMORY_BPF";
    table[7] = "VM_KERN_MEMORY_IPC";
    table[8] = "VM_KERN_MEMORY_STACK";
    table[9] = "VM_KERN_MEMORY_CPU";
    table[10] = "VM_KERN_MEMORY_PMAP";
    table[11] = "VM_KERN_MEMORY_PTE";
    table[12] = "VM_KERN_MEMORY_ZONE";
    table[13] = "VM_KERN_MEMORY_KALLOC";
    table[14] = "VM_KERN_MEMORY_COMPRESSOR";
    table[15] = "VM_KERN_MEMORY_COMPRESSED_DATA";
    table[16] = "VM_KERN_MEMORY_PHANTOM_CACHE";
    table[17] = "VM_KERN_MEMORY_WAITQ";
    table[18] = "VM_KERN_MEMORY_DIAG";
    table[19] = "VM_KERN_MEMORY_LOG";
    table[20] = "VM_KERN_MEMORY_FILE";
    table[21] = "VM_KERN_MEMORY_MBUF";
    table[22] = "VM_KERN_MEMORY_UBC";
    table[23] = "VM_KERN_MEMORY_SECURITY";
    table[24] = "VM_KERN_MEMORY_MLOCK";
    table[25] = "VM_KERN_MEMORY_REASON";
    table[26] = "VM_KERN_MEMORY_NET";
    table[27] = "VM_KERN_MEMORY_LTABLE";
    table[28] = "VM_KERN_MEMORY_FIRST_DYNAMIC";
    table[255] = "VM_KERN_MEMORY_ANY";
    return table;
}
constexpr std::array<const char *, 256> kSiteTagNames = makeSiteTagTable();

constexpr std::array<const char *, 11> kCounterNames = {
    "VM_KERN_COUNT_MANAGED",       "VM_KERN_COUNT_RESERVED",   "VM_KERN_COUNT_WIRED",
    "VM_KERN_COUNT_WIRED_MANAGED", "VM_KERN_COUNT_STOLEN",     "VM_KERN_COUNT_LOPAGE",
    "VM_KERN_COUNT_MAP_KERNEL",    "VM_KERN_COUNT_MAP_ZONE",   "VM_KERN_COUNT_MAP_KALLOC",
    "VM_KERN_COUNT_WIRED_BOOT",    "VM_KERN_COUNT_BOOT_STOLEN",
};

// Type, wired and zone bits: an entry is a counter only when it is neither
// wired nor a zone's share.
constexpr uint64_t kCounterMask = vs::kSiteTypeMask | vs::kSiteFlagWired | vs::kSiteFlagZoneShare;

// Text of a fixed-width, zero-padded field that need not be terminated.
std::string_view fixedField(const char *field, size_t width) {
    size_t length = 0;
    while (length < width && field[length] != '\0') {
        ++length;
    }
    return std::string_view(field, length);
}

bool isValidUtf8(std::string_view text) {
    size_t i = 0;
    while (i < text.size()) {
        const auto lead = static_cast<unsigned char>(text[i]);
        size_t follow;
        uint32_t codePoint;
        if (lead < 0x80) {
            ++i;
            continue;
        } else if ((lead & 0xE0) == 0xC0) {
            follow = 1;
            codePoint = lead & 0x1F;
        } else if ((lead & 0xF0) == 0xE0) {
            follow = 2;
            codePoint = lead & 0x0F;
        } else if ((lead & 0xF8) == 0xF0) {
            follow = 3;
            codePoint = lead & 0x07;
        } else {
            return false;
        }
        if (i + follow >= text.size()) {
            return false;
        }
        for (size_t k = 1; k <= follow; ++k) {
            const auto next = static_cast<unsigned char>(text[i + k]);
            if ((next & 0xC0) != 0x80) {
                return false;
            }
            codePoint = (codePoint << 6) | (next & 0x3F);
        }
        static constexpr uint32_t kSmallest[] = {0, 0x80, 0x800, 0x10000};
        if (codePoint < kSmallest[follow] || codePoint > 0x10FFFF || (codePoint >= 0xD800 && codePoint <= 0xDFFF)) {
            return false;
        }
        i += follow + 1;
    }
    return true;
}

template <class... Args>
std::string format(const char *pattern, Args... args) {
    char buffer[128];
    const int length = std::snprintf(buffer, sizeof buffer, pattern, args...);
    return std::string(buffer, std::min(static_cast<size_t>(std::max(length, 0)), sizeof buffer - 1));
}

uint64_t objectIdForSite(const VSKernelSiteInfo &info) {
    switch (info.flags & vs::kSiteTypeMask) {
    case vs::kSiteTypeTag:
        return info.site ^ vs::kKernelTagSiteObjectBits;
    case vs::kSiteTypeKext:
        return info.site ^ vs::kKernelKextSiteObjectBits;
    case vs::kSiteTypeCounter:
        return info.site ^ vs::kKernelCounterSiteObjectBits;
    default:
        return info.site ^ vs::kKernelCodeSiteObjectBits;
    }
}

// Arrays from kernel_memory_info go back to the platform; a refusal is
// worth a line but changes nothing gathered.
template <class Record>
void releaseArray(VSPlatform &platform, const std::string &label, std::span<const Record> array) {
    const VSReturnCode code = platform.release_memory(array.data(), array.size() * sizeof(Record));
    if (code != vs::kReturnSuccess) {
        std::fprintf(stderr, "%s: release_memory: %s\n", label.c_str(), platform.error_text(code).c_str());
    }
}

}  // namespace

// ---- construction ------------------------------------------------------------------

bool VSKernelProcess::initWithBsdInfo(const VSBsdInfo &info) {
    if (!VSProcess::initWithBsdInfo(info)) {
        return false;
    }
    _setIdleExitStatus(VSIdleExitUnsupported);
    return true;
}

uint64_t VSKernelProcess::_gatherPageSize() { return VSPlatform::current().kernel_page_size(); }

std::shared_ptr<const VSAuxDataDictionary> VSKernelProcess::auxData() const {
    return vs::makeAuxDictionary({{"Maps", vs::makeAuxDictionary(_auxData)}});
}

// ---- gathering ---------------------------------------------------------------------

void VSKernelProcess::gatherData() {
    VSPlatform &platform = VSPlatform::current();
    std::span<const VSKernelZoneName> zoneNames;
    std::span<const VSKernelZoneInfo> zoneInfos;
    std::span<const VSKernelSiteInfo> siteInfos;
    const VSReturnCode code = platform.kernel_memory_info(zoneNames, zoneInfos, siteInfos);
    if (code != vs::kReturnSuccess) {
        const std::string text = platform.error_text(code);
        std::fprintf(stderr, "%s: kernel_memory_info: %s\n", displayString().c_str(), text.c_str());
        _addError(displayString() + ": " + text);
        return;
    }

    VSMemoryRegionList regions;
    const uint32_t zoneCount = static_cast<uint32_t>(zoneNames.size());
    VS_ASSERT(zoneInfos.size() >= zoneNames.size());
    regions.reserve(zoneNames.size() + siteInfos.size());
    for (uint32_t i = 0; i < zoneCount; ++i) {
        const VSKernelZoneInfo &info = zoneInfos[i];
        auto region = std::make_unique<VSMemoryRegion>();
        region->setName(std::string(fixedField(zoneNames[i].name, sizeof zoneNames[i].name)));
        uint64_t dirty = info.currentSize;
        if (info.collectable != 0) {
            // Elements in use are the live part; the rest of a collectable
            // zone can be given back. A racy snapshot never makes the live
            // part exceed the zone.
            dirty = std::min(info.elementsInUse * info.elementSize, info.currentSize);
        }
        region->setDirtySize(dirty);
        region->setReclaimableSize(info.currentSize - dirty);
        region->setSize(info.currentSize);
        region->setDetailedName("zone");
        region->setObject_id(i | vs::kKernelZoneObjectBits);
        regions.push_back(std::move(region));
    }
    releaseArray(platform, displayString(), zoneInfos);

    _addWiredData(siteInfos, static_cast<uint32_t>(siteInfos.size()), zoneNames.data(), zoneCount, regions);

    // The zone names are released only now: the site names above use them.
    releaseArray(platform, displayString(), zoneNames);
    releaseArray(platform, displayString(), siteInfos);
    setMemoryRegions(std::move(regions));
}

void VSKernelProcess::_addWiredData(std::span<const VSKernelSiteInfo> infos, uint32_t count,
                                    const VSKernelZoneName *zoneNames, uint32_t zoneCount,
                                    VSMemoryRegionList &regions) {
    VS_ASSERT(count <= infos.size());
    const std::unique_ptr<VSKernelSymbolicator> symbolicator = VSPlatform::current().kernel_symbolicator();
    const KextTags kexts = kextTags();
    if (count == 0) {
        return;
    }
    for (uint32_t i = 0; i < count; ++i) {
        const VSKernelSiteInfo &info = infos[i];
        const bool counter = (info.flags & kCounterMask) == vs::kSiteTypeCounter;
        const uint64_t value = counter ? info.mapped : info.size;
        if (info.site == 0 && value == 0) {
            continue;
        }
        if (counter) {
            const std::string name = _nameForWiredInfo(info, kexts, symbolicator.get(), nullptr, 0);
            _auxData.insert_or_assign(name, vs::makeAuxData(static_cast<int64_t>(value), false));
            continue;
        }

        auto region = std::make_unique<VSMemoryRegion>();
        const bool wired = (info.flags & vs::kSiteFlagWired) != 0;
        const bool hidden = (info.flags & vs::kSiteFlagHidden) != 0;
        // Locked user pages are wired, but they are process memory that the
        // processes' own regions already count: here they count as clean.
        // Only the tag means that; a module or counter numbered 24 is not.
        const bool userWired =
            (info.flags & vs::kSiteTypeMask) == vs::kSiteTypeTag && info.site == vs::kKernelSiteUserWired;
        uint64_t giveBack = 0;
        if ((info.flags & vs::kSiteFlagZoneShare) != 0 || !wired || hidden || userWired) {
            region->setCleanNonSpecSize(value);
            region->setDirtySize(0);
            if (hidden) {
                region->setDetailedName("(hidden)");
            } else if (userWired) {
                region->setDetailedName("(user wired)");
            }
        } else {
            // A site may say how much of it the kernel can give back.
            giveBack = std::min(info.collectable, value);
            region->setDirtySize(value - giveBack);
            region->setCleanNonSpecSize(0);
        }
        region->setWiredSize(wired ? value : 0);
        region->setSwappedSize(0);
        region->setReclaimableSize(giveBack);
        region->setSize(value);
        region->setUser_tag(i);
        region->setObject_id(objectIdForSite(info));
        _setNameForRegion(*region, info, kexts, symbolicator.get(), zoneNames, zoneCount);
        regions.push_back(std::move(region));
    }
}

// ---- names -------------------------------------------------------------------------

const char *VSKernelProcess::siteTagName(uint64_t tag) { return tag < kSiteTagNames.size() ? kSiteTagNames[tag] : nullptr; }

const char *VSKernelProcess::counterName(uint64_t index) {
    return index < kCounterNames.size() ? kCounterNames[index] : nullptr;
}

VSKernelProcess::KextTags VSKernelProcess::kextTags() {
    return _kextTagsWithKextInfo(VSPlatform::current().loaded_kext_info());
}

VSKernelProcess::KextTags VSKernelProcess::_kextTagsWithKextInfo(const std::map<std::string, VSKextInfo> &kextInfo) {
    KextTags tags;
    for (const auto &[bundleIdentifier, info] : kextInfo) {
        tags.insert_or_assign(info.loadTag, info);
    }
    return tags;
}

std::string VSKernelProcess::_nameForWiredInfo(const VSKernelSiteInfo &info, const KextTags &kexts,
                                               const VSKernelSymbolicator *symbolicator,
                                               const VSKernelZoneName *zoneNames, uint32_t zoneCount) {
    const uint64_t site = info.site;
    const auto longSite = static_cast<unsigned long long>(site);
    std::string name;
    bool named = false;
    if ((info.flags & vs::kSiteFlagNamed) != 0) {
        const std::string_view own = fixedField(info.name, sizeof info.name);
        if (isValidUtf8(own)) {
            name = own;
            named = true;
        }
    }
    if (!named) {
        const uint64_t type = info.flags & vs::kSiteTypeMask;
        switch (type) {
        case vs::kSiteTypeTag:
            if (const char *fixed = siteTagName(site)) {
                name = fixed;
            } else {
                name = format("VM_KERN_MEMORY_%llu", longSite);
            }
            break;
        case vs::kSiteTypeKext: {
            auto kext = kexts.find(site);
            if (kext != kexts.end() && kext->second.bundleIdentifier) {
                name = *kext->second.bundleIdentifier;
            } else {
                name = format("unloaded kmod %llu", longSite);
            }
            break;
        }
        case vs::kSiteTypeCodeAddress: {
            std::optional<std::string> symbol;
            if (site != 0 && symbolicator != nullptr) {
                symbol = symbolicator->symbol_name_at(site);
            }
            name = symbol ? std::move(*symbol) : format("site 0x%llx", longSite);
            break;
        }
        case vs::kSiteTypeCounter:
            if (const char *fixed = counterName(site)) {
                name = fixed;
            } else {
                name = format("VM_KERN_COUNT_%llu", longSite);
            }
            break;
        default:
            name = format("unknown site (0x%x, 0x%llx)", static_cast<unsigned>(type), longSite);
            break;
        }
    }
    if (zoneNames != nullptr && (info.flags & vs::kSiteFlagZoneShare) != 0 && info.zone < zoneCount) {
        const VSKernelZoneName &zone = zoneNames[info.zone];
        name += '[';
        name += fixedField(zone.name, sizeof zone.name);
        name += ']';
    }
    return name;
}

void VSKernelProcess::_setNameForRegion(VSMemoryRegion &region, const VSKernelSiteInfo &info, const KextTags &kexts,
                                        const VSKernelSymbolicator *symbolicator, const VSKernelZoneName *zoneNames,
                                        uint32_t zoneCount) {
    region.setName(_nameForWiredInfo(info, kexts, symbolicator, zoneNames, zoneCount));
    if ((info.flags & vs::kSiteTypeMask) != vs::kSiteTypeCodeAddress || symbolicator == nullptr) {
        return;
    }
    if (auto location = symbolicator->source_location_at(info.site); location && location->path) {
        region.setDetailedName("(" + *location->path + ":" + std::to_string(location->line) + ")");
    }
}
