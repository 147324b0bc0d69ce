#pragma once

// Turning parsed smaps mappings into the walk's region records. Linux has
// no allocator tags, no object ids and no share modes; they are derived
// here from what smaps tells, in one place, so that the walk and the tests
// agree on every rule.

#include "targets/platform/linux/smaps_parser.h"
#include "targets/platform/platform.h"

#include <cstdint>
#include <vector>

namespace vs {

class ObjectIdTable;

// The user tag of a mapping. `stackPointers` are the stack pointers of the
// process's threads, sorted: an anonymous mapping holding one is a stack.
uint32_t userTagFor(const SmapsRegion &region, MappingKind kind,
                    const std::vector<uint64_t> &stackPointers);

// The object id of a mapping: per (device, inode) for files and shmem, per
// name for the kernel's special mappings, fresh for anonymous memory.
uint32_t objectIdFor(const SmapsRegion &region, MappingKind kind, ObjectIdTable &ids);

// The full record (counts in pages of `pageSize`).
VSRegionInfo regionInfoFor(const SmapsRegion &region, MappingKind kind, uint32_t userTag,
                           uint32_t objectId, uint64_t pageSize);

// The top-level record of the same mapping.
VSRegionBasicInfo basicInfoFor(const SmapsRegion &region, MappingKind kind, uint64_t pageSize);

} // namespace vs
