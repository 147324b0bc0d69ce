#include "cli/heapfile_capture_identities.h"

#include <vector>

#include "targets/platform/linux/linux_platform.h"
#include "targets/platform/linux/smaps_parser.h"

namespace vs {

std::map<uint64_t, std::string> linuxRegionIdentities(VSLinuxPlatform &platform, VSTaskHandle task) {
    std::map<uint64_t, std::string> identities;
    std::vector<SmapsRegion> regions;
    if (platform.task_regions(task, regions) != kReturnSuccess) {
        return identities;
    }
    for (const SmapsRegion &region : regions) {
        const std::string offset = std::to_string(region.offset);
        if (region.inode != 0) {
            identities[region.start] = "file " + std::to_string(region.devMajor) + ":" +
                                       std::to_string(region.devMinor) + " inode " + std::to_string(region.inode) +
                                       " offset " + offset;
        } else if (region.path == "[vdso]" || region.path == "[vvar]" || region.path == "[vvar_vclock]" ||
                   region.path == "[vsyscall]") {
            identities[region.start] = "kernel mapping " + region.path + " offset " + offset;
        }
    }
    return identities;
}

}  // namespace vs
