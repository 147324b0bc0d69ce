#pragma once

// Stable identities of the Linux layer's memory objects, for heapfile
// captures: a file is its device and inode (a private mapping's window of
// it adds the offset), a kernel-provided mapping (vdso, vvar, vsyscall) its
// name. Heapfiles captured at different times then still share what live
// processes share. Anonymous memory has no identity beyond its run.

#include <cstdint>
#include <optional>
#include <string>

namespace vs {

std::optional<std::string> linuxObjectIdentity(uint32_t objectId);

}  // namespace vs
