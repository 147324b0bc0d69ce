#pragma once

// Memory object ids for Linux mappings. The kernel exposes no object ids,
// yet the accounting merges regions of all processes by object, so the
// layer makes them up, once per run:
//   - files and shmem: one id per (device, inode), so every process that
//     maps libc or the same shared memory gets the same id;
//   - [vdso], [vvar], [vvar_vclock], [vsyscall]: one id per name (the same
//     kernel pages in every process);
//   - anonymous memory: a fresh id per region.
// Ids are dense from 1, so they fit 32 bits and 0 (no object) never occurs.

#include <cstdint>
#include <mutex>
#include <string>
#include <string_view>
#include <unordered_map>

namespace vs {

class ObjectIdTable {
public:
    uint32_t idForFile(uint64_t device, uint64_t inode);
    uint32_t idForName(std::string_view name);
    uint32_t freshId();

    // The table every Linux layer of this run shares.
    static ObjectIdTable &shared();

private:
    struct FileKey {
        uint64_t device;
        uint64_t inode;
        bool operator==(const FileKey &) const = default;
    };
    struct FileKeyHash {
        size_t operator()(const FileKey &k) const {
            return std::hash<uint64_t>()(k.inode * 0x9E3779B97F4A7C15ull ^ k.device);
        }
    };

    uint32_t _nextLocked();

    std::mutex _mutex;
    uint32_t _last = 0;
    std::unordered_map<FileKey, uint32_t, FileKeyHash> _files;
    std::unordered_map<std::string, uint32_t> _names;
};

} // namespace vs
