#pragma once

// Memory object ids for Linux mappings. The kernel exposes no object ids,
// yet the accounting merges regions of all processes by object, so the
// layer makes them up, once per run:
//   - a shared mapping's pages, and shmem: one id per (device, inode), so
//     every process that maps the same file or shared memory gets the same
//     id;
//   - the page cache pages a private file mapping shows: one id per
//     (device, inode, file offset) window. Processes map an image's
//     segments at the same offsets, so each segment stays an object (and a
//     report row) of its own;
//   - [vdso], [vvar], [vvar_vclock], [vsyscall]: one id per name (the same
//     kernel pages in every process);
//   - anonymous pages several targets map (copy-on-write after fork, KSM):
//     one id per (set of targets, address), from the run's frame index
//     (the address where the member mapping them lowest has them);
//   - any other anonymous memory: a fresh id per mapping.
// Ids are dense from 1, so they fit 32 bits and 0 (no object) never occurs.

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>

namespace vs {

class ObjectIdTable {
public:
    uint32_t idForFile(uint64_t device, uint64_t inode);
    uint32_t idForFileWindow(uint64_t device, uint64_t inode, uint64_t offset);
    uint32_t idForName(std::string_view name);
    uint32_t idForFrameSet(uint32_t set, uint64_t address);
    uint32_t freshId();

    // What an id stands for in terms that mean the same in another run
    // ("file 254:0 inode 1234", with " offset N" for a window, "kernel
    // mapping [vdso]"); nullopt for memory known only to this run.
    std::optional<std::string> stableIdentity(uint32_t id) const;

    // The table every Linux layer of this run shares.
    static ObjectIdTable &shared();

private:
    enum class Kind : uint8_t { File, FileWindow, Name, FrameSet };
    using Key = std::tuple<Kind, uint64_t, uint64_t, uint64_t, std::string>;

    uint32_t _idFor(Key key);

    mutable std::mutex _mutex;
    uint32_t _last = 0;
    std::map<Key, uint32_t> _ids;
    std::map<uint32_t, Key> _keys;
};

} // namespace vs
