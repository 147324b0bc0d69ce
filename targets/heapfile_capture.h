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
// Anonymous memory is written with the dirty bytes the live walk counts
// (all resident pages but the reusable ones), because the heapfile walk
// takes the recorded dirty bytes as they are.
//
// A mapping that holds pages of several objects is written as one region
// per part, each repeating the mapping's address and length.
//
// Object ids. Live ids are numbers of one run. A heapfile's ids are 32-bit
// hashes: of the object's stable identity (a file's device and inode, with
// the offset of a private mapping's window; a special kernel mapping's
// name) when the identity provider knows it, so that separately captured
// heapfiles share a library as live processes do; otherwise of the live id
// and a salt drawn once per capture session, so that processes captured
// together share what they share live and never meet the private memory
// of another session. Each region keeps its offset in its object.
// Hash collisions are possible but rare (a few thousand objects in 2^32).

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "targets/heapfile_format.h"
#include "targets/platform/platform.h"

namespace vs {

// The stable identity of a live object id (see above), or nullopt for
// memory known only to this run.
using RegionIdentityProvider = std::function<std::optional<std::string>(uint32_t objectId)>;

class HeapfileCapture {
public:
    // `salt` fixes the session salt (tests); by default it is random.
    explicit HeapfileCapture(RegionIdentityProvider identities = {}, std::optional<uint64_t> salt = std::nullopt);

    // Gathers the process through the installed platform and returns its
    // snapshot; nullopt with a printable error when the process cannot be
    // opened or read, or has a shared cache region (which a capture cannot
    // record).
    std::optional<VSHeapfileSnapshot> capture(int32_t pid, HeapfileError *error) const;

    // Several processes captured together: anonymous pages they share (a
    // fork family) stay shared between their snapshots, counted once when
    // the heapfiles are analysed together. One result per pid, in order.
    struct Captured {
        std::optional<VSHeapfileSnapshot> snapshot;
        HeapfileError error;
    };
    std::vector<Captured> captureTogether(const std::vector<int32_t> &pids) const;

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
