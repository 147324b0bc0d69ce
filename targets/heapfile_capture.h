#pragma once

// Writing heapfiles from live processes. A capture gathers the process
// exactly as a live run does (same platform queries, same images, same
// walk) and records, per walked region, the record the walk saw, so that
// analysing the heapfile later gives the figures the live run gives.
//
// What a heapfile cannot carry, and so reads differently:
// - user-wired pages (the heapfile walk sets no wired count);
// - reusable pages (given back with MADV_FREE): they read as clean instead
//   of reclaimable;
// - mapping offsets: the heapfile walk places every region of an object at
//   offset 0, so each distinct (object, offset) pair is written as an
//   object of its own. Regions of one object that overlap at different
//   offsets are then no longer de-duplicated against each other.
// Anonymous memory is written with the dirty bytes the live walk counts
// (all resident pages but the reusable ones), because the heapfile walk
// takes the recorded dirty bytes as they are.
//
// Object ids. Live ids are numbers of one run. A heapfile's ids are 32-bit
// hashes: of the region's stable identity (file device, inode and offset;
// a special kernel mapping's name) when the identity provider knows it, so
// that separately captured heapfiles share a library as live processes
// do; otherwise of the live id, the offset and a salt drawn once per
// capture session, so that processes captured together share what they
// share live and never meet the private memory of another session.
// Hash collisions are possible but rare (a few thousand objects in 2^32).

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>

#include "targets/heapfile_format.h"
#include "targets/platform/platform.h"

namespace vs {

// Stable identities of a task's regions, by region start. Regions it
// leaves out are private to their process.
using RegionIdentityProvider = std::function<std::map<uint64_t, std::string>(VSTaskHandle task)>;

class HeapfileCapture {
public:
    // `salt` fixes the session salt (tests); by default it is random.
    explicit HeapfileCapture(RegionIdentityProvider identities = {}, std::optional<uint64_t> salt = std::nullopt);

    // Gathers the process through the installed platform and returns its
    // snapshot; nullopt with a printable error when the process cannot be
    // opened or read, or has a shared cache region (which a capture cannot
    // record).
    std::optional<VSHeapfileSnapshot> capture(int32_t pid, HeapfileError *error) const;

private:
    RegionIdentityProvider _identities;
    uint64_t _salt;
};

// NAME-PID.heap, with characters that cannot stand in a file name
// (slashes, control characters, a leading dot) replaced by '_'.
std::string heapfileFileName(const VSHeapfileSnapshot &snapshot);

// Writes the text to a temporary file next to `path` and renames it into
// place, so that a reader sees the old file or the whole new one and an
// interrupted capture leaves no half-written heapfile. False with the
// reason (naming the file) in `error`.
bool writeFileAtomically(const std::string &path, const std::string &text, HeapfileError *error);

}  // namespace vs
