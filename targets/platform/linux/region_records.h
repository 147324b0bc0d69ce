#pragma once

// Turning parsed smaps mappings into the walk's region records. Linux has
// no allocator tags, no object ids and no share modes; they are derived
// here from what smaps tells, in one place, so that the walk and the tests
// agree on every rule.

#include "targets/platform/linux/shared_pages.h"
#include "targets/platform/linux/smaps_parser.h"
#include "targets/platform/platform.h"

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

namespace vs {

class ObjectIdTable;

// The user tag of a mapping. `stackPointers` are the stack pointers of the
// process's threads, sorted: an anonymous mapping holding one is a stack.
uint32_t userTagFor(const SmapsRegion &region, MappingKind kind,
                    const std::vector<uint64_t> &stackPointers);

// Anonymous pages of a private mapping that other targets map too (after
// fork, or merged by KSM): one set of targets' share of the mapping.
struct SharedAnonymousPart {
    uint32_t objectId = 0;   // the set's object at this address
    uint64_t offset = 0;     // where the part lies in that object
    uint64_t presentPages = 0;
    uint64_t swappedPages = 0;
};

// Page cache pages of a mapping, and how many of them are dirty (a private
// mapping's own copies left out).
uint64_t filePages(const SmapsRegion &region, uint64_t pageSize);
uint64_t fileDirtyPages(const SmapsRegion &region, uint64_t pageSize);

// Does the mapping show page cache of a file (or shmem object) that other
// mappings may hold other pages of? Such windows count the union.
bool isFileWindow(const SmapsRegion &region, MappingKind kind, uint64_t pageSize);

// Does the mapping hold anonymous pages that may be mapped by other
// processes too? Only such mappings need their frames looked up.
bool mayShareAnonymousPages(const SmapsRegion &region, MappingKind kind);

// The records of a mapping, one per part, each in exactly one memory object
// (counts in pages of `pageSize`):
//   - file pages (Rss - Anonymous of a file or shmem mapping, page cache
//     dirtied by write() included): the file's object at its file offsets
//     (for a private mapping, the window of the file it shows);
//   - anonymous pages this process alone maps: the mapping's own object;
//   - anonymous pages shared with other targets: one part per set (`shared`).
// A mapping with nothing resident or swapped is one empty part. Hugetlb
// pages, which Rss leaves out, count as resident and dirty.
std::vector<VSRegionInfo> regionPartsFor(const SmapsRegion &region, MappingKind kind, uint32_t userTag,
                                         ObjectIdTable &ids, uint64_t pageSize,
                                         const std::vector<SharedAnonymousPart> &shared = {},
                                         const std::optional<ObjectPages> &objectPages = std::nullopt);

// The top-level record of the same mapping.
VSRegionBasicInfo basicInfoFor(const SmapsRegion &region, MappingKind kind, uint64_t pageSize);

// Part records wait for the walk packed (variable-length numbers): a
// record is 68 bytes and a process may have a million, nearly every field
// of which is a small number. unpackRegionInfo gives back exactly what was
// packed and moves `at` past it.
void packRegionInfo(const VSRegionInfo &info, std::vector<uint8_t> &out);
VSRegionInfo unpackRegionInfo(std::span<const uint8_t> bytes, size_t &at);

} // namespace vs
