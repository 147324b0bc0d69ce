#pragma once

// Stable identities of the regions of a Linux task, for heapfile captures:
// a file mapping is its device, inode and offset, a kernel-provided mapping
// (vdso, vvar, vsyscall) its name and offset. Heapfiles captured at
// different times then still share what live processes share. Anonymous
// memory has no identity beyond its process and is left out.

#include <cstdint>
#include <map>
#include <string>

#include "targets/platform/platform.h"

class VSLinuxPlatform;

namespace vs {

// By region start; empty when the task's regions cannot be read.
std::map<uint64_t, std::string> linuxRegionIdentities(VSLinuxPlatform &platform, VSTaskHandle task);

}  // namespace vs
