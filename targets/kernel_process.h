#pragma once

// The kernel as a target (pid 0). Its memory is not walked region by
// region: one platform query reports the kernel's zones (allocators of
// fixed-size elements, the slab caches on Linux) and its wired memory split
// by allocation site. Every zone and every site entry becomes one region
// with a synthetic object id; counter entries become auxiliary data under
// "Maps".
//
// Synthetic object ids keep the kinds apart in their upper bits (zones
// 0x2xxxxxxxx, tags 0x3..., modules 0x5..., wired counters 0x4..., code
// addresses XOR 0x1...), above every 32-bit object id the Linux layer
// hands to process regions.

#include <cstdint>
#include <map>
#include <memory>
#include <span>
#include <string>

#include "targets/process.h"

class VSKernelProcess : public VSProcess {
public:
    // Load tag -> the loaded kernel extension (module) carrying it.
    using KextTags = std::map<uint64_t, VSKextInfo>;

    // Made by VSProcess::processWithBsdInfo for the system record.
    VSKernelProcess() = default;

    // Reads zones and wired sites through kernel_memory_info. A failing
    // query leaves the target without regions and with one error (and one
    // line on standard error).
    void gatherData() override;
    // {"Maps": counters}, also when no counter was reported.
    std::shared_ptr<const VSAuxDataDictionary> auxData() const override;
    bool _isAlive() const override { return true; }

    // Turns site entries into regions (appended to `regions`) and counter
    // entries into "Maps" data. `zoneNames` may be null (then `zoneCount`
    // is meaningless); entries are indexed 0.. and the index becomes the
    // region's user tag.
    void _addWiredData(std::span<const VSKernelSiteInfo> infos, uint32_t count, const VSKernelZoneName *zoneNames,
                       uint32_t zoneCount, VSMemoryRegionList &regions);

    // The loaded kernel extensions by load tag.
    static KextTags kextTags();
    static KextTags _kextTagsWithKextInfo(const std::map<std::string, VSKextInfo> &kextInfo);

    // The name of a site entry: its own name, the tag or counter table,
    // the module's name, the symbol at a code address, or a fallback that
    // shows the raw numbers; a zone share gets the zone name appended in
    // brackets when zone names are given. `symbolicator` may be null.
    static std::string _nameForWiredInfo(const VSKernelSiteInfo &info, const KextTags &kexts,
                                         const VSKernelSymbolicator *symbolicator, const VSKernelZoneName *zoneNames,
                                         uint32_t zoneCount);
    // Names the region after its site entry and, for a code address with a
    // known source location, details it as "(path:line)".
    static void _setNameForRegion(VSMemoryRegion &region, const VSKernelSiteInfo &info, const KextTags &kexts,
                                  const VSKernelSymbolicator *symbolicator, const VSKernelZoneName *zoneNames,
                                  uint32_t zoneCount);

    // The fixed tables; nullptr for a slot without a name.
    static const char *siteTagName(uint64_t tag);
    static const char *counterName(uint64_t index);

protected:
    bool initWithBsdInfo(const VSBsdInfo &info) override;
    uint64_t _gatherPageSize() override;
    bool _populateTask() override { return true; }

private:
    // Counter name -> value; filled by gatherData on its worker, read after
    // the gathering has been joined.
    VSAuxDataDictionary::Entries _auxData;
};

namespace vs {

// Object-id bits of the kernel's synthetic regions.
inline constexpr uint64_t kKernelZoneObjectBits = 0x200000000;
inline constexpr uint64_t kKernelTagSiteObjectBits = 0x300000000;
inline constexpr uint64_t kKernelKextSiteObjectBits = 0x500000000;
inline constexpr uint64_t kKernelCodeSiteObjectBits = 0x100000000;
inline constexpr uint64_t kKernelCounterSiteObjectBits = 0x400000000;

// The site of user pages locked in memory: wired, but charged as clean
// because the pages belong to processes.
inline constexpr uint64_t kKernelSiteUserWired = 24;

}  // namespace vs
