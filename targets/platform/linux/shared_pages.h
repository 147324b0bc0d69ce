#pragma once

// What the targets of one run share page by page, which no single
// process's smaps can tell:
//   - anonymous pages mapped by several targets (copy-on-write after fork,
//     KSM), found by frame number or swap entry: each such page belongs to
//     the exact set of targets that map it, interned as a small set id;
//   - the pages of a shared file or shmem object that several mappings
//     touch in different parts: the union of the pages any of them has
//     resident, by file page.
// Targets add what they map (from several threads) before any target is
// walked; the walk then only looks up. The index holds one entry per page
// that may be shared, never one per process and page.

#include <array>
#include <atomic>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <span>
#include <tuple>
#include <unordered_map>
#include <utility>
#include <vector>

namespace vs {

// Swapped pages are keyed by their swap entry with this bit set, so that
// they never meet a frame number (frame numbers have at most 55 bits).
inline constexpr uint64_t kSwapKey = 1ull << 63;

// Keys of consecutive pages mostly follow each other (neighbouring frames,
// neighbouring swap slots): they travel as runs, and the index works a run
// at a time. A run also says at which virtual page of its process its first
// key is mapped; the pages of a run are consecutive there too.
struct KeyRun {
    uint64_t first = 0;
    uint64_t length = 0;
    uint64_t page = 0; // address / page size
    bool operator==(const KeyRun &) const = default;
};
// Appends `key`, mapped at virtual page `page`, to `runs`, extending the
// last run when it follows it.
inline void appendKey(std::vector<KeyRun> &runs, uint64_t key, uint64_t page) {
    if (!runs.empty() && runs.back().first + runs.back().length == key &&
        runs.back().page + runs.back().length == page) {
        runs.back().length += 1;
    } else {
        runs.push_back({key, 1, page});
    }
}

// A process's page keys kept between its first look and its walk, small:
// each run as (distance from the end of the last run, length, distance of
// its page from where the last run's pages end), each a variable-length
// number.
void encodeKeyRuns(std::span<const KeyRun> runs, std::vector<uint8_t> &out);
// Appends the runs of `bytes` (as encodeKeyRuns wrote them) to `runs`.
void decodeKeyRuns(std::span<const uint8_t> bytes, std::vector<KeyRun> &runs);

// The whole object's pages within a shared mapping's range, where several
// mappings of the object hold different pages (the union of what they
// have resident), replacing the mapping's own counts.
struct ObjectPages {
    uint64_t residentPages = 0;
    uint64_t dirtyPages = 0;
};

class SharedPageIndex {
public:
    // The pages of a target that other targets may map too (keys as
    // above), all at once: a page the target maps twice is still one member.
    void addPages(int32_t pid, std::span<const KeyRun> runs);
    // Where a mapping's first page that others may map too lies: members of
    // a fork family place their copies where the lowest of them has them,
    // so that a copy one of them moved (mremap) stays one object.
    void notePlace(uint64_t key, uint64_t page);

    // The set of targets mapping the page when it has more than one
    // member; nullopt for a page one target alone maps.
    std::optional<uint32_t> sharedSet(uint64_t key) const;
    // How many of the pages of `runs` lie in each set of more than one
    // target, swapped pages apart; pages of one target alone are left out.
    // Of the first page met in each set: the virtual page it is mapped at in
    // `runs`, and the lowest virtual page any target noted for it (where a
    // member moved its copy with mremap, the two differ).
    struct SetPages {
        uint32_t set = 0;
        uint64_t presentPages = 0;
        uint64_t swappedPages = 0;
        uint64_t firstPage = 0;
        uint64_t lowestPage = 0;
    };
    void sharedPages(std::span<const KeyRun> runs, std::vector<SetPages> &out) const;
    // The pids of a set, sorted.
    std::vector<int32_t> setMembers(uint32_t set) const;

    // The pages a mapping of an object holds, one bit per page from file
    // page `firstPage` on (`present` empty: every page of `pageCount`);
    // `dirty` empty when the dirty state is unknown, with `dirtyCount`
    // the mapping's own count of dirty pages instead.
    // Page cache that private mappings show is kept apart from what shared
    // mappings of the file hold: the two are objects of their own.
    struct Window {
        uint64_t device = 0;
        uint64_t inode = 0;
        uint64_t firstPage = 0;
        uint64_t pageCount = 0;
        std::vector<uint64_t> present;
        std::vector<uint64_t> dirty;
        uint64_t dirtyCount = 0;
        bool privateMapping = false;
    };
    void addWindow(const Window &window);

    // The object's pages within [firstPage, firstPage + pageCount): how
    // many any mapping holds and how many of those are dirty. nullopt when
    // one mapping alone maps the object (its own counts are exact).
    std::optional<ObjectPages> objectPages(uint64_t device, uint64_t inode, bool privateMappings,
                                           uint64_t firstPage, uint64_t pageCount) const;

    // No page is added from now on: lookups need no locks.
    void freeze() { _frozen.store(true); }

    void clear();

private:
    struct ObjectBits {
        uint32_t mappings = 0;
        std::vector<uint64_t> present; // by file page
        std::vector<uint64_t> dirty;
        uint64_t unknownDirty = 0; // the most dirty pages one mapping of unknown state had
    };

    uint32_t _setWith(uint32_t set, int32_t pid);
    uint64_t _placeOf(uint64_t key, bool frozen) const;

    // Page key -> set, by blocks of 8 neighbouring keys (a process's
    // frames come in runs, so one probe serves several pages): open
    // addressing over block numbers, at most 70% full. A key never seen
    // reads as set 0, the empty set.
    static constexpr unsigned kBlockShift = 3;
    // Calls `piece(shard, first, length)` for the parts of a run that lie in
    // one shard each.
    template <typename Piece>
    static void _forEachPiece(const KeyRun &run, Piece &&piece);
    class PageTable {
    public:
        static constexpr size_t kLanes = size_t{1} << kBlockShift;
        static constexpr size_t kNoSlot = SIZE_MAX;
        // The slot of a block's keys, or kNoSlot when none was added.
        size_t find(uint64_t block) const;
        // The same, made when missing; valid until the next call.
        size_t findOrAdd(uint64_t block);
        uint32_t *sets(size_t slot) { return &_sets[slot * kLanes]; }
        const uint32_t *sets(size_t slot) const { return &_sets[slot * kLanes]; }
        void clear();

    private:
        void _grow();
        std::vector<uint64_t> _blocks; // block + 1; 0: a free slot
        std::vector<uint32_t> _sets;   // kLanes per slot
        size_t _count = 0;
    };

    // Pages are spread over shards, each with its own lock, so that
    // targets add their pages side by side; 512 neighbouring keys (2 MiB of
    // frames) share a shard, so a run seldom needs more than one.
    static constexpr size_t kShards = 16;
    static constexpr unsigned kChunkShift = 9;
    struct Shard {
        std::mutex mutex;
        PageTable pages;
    };
    static size_t _shardOf(uint64_t key) {
        return static_cast<size_t>(((key >> kChunkShift) * 0x9E3779B97F4A7C15ull) >> 60);
    }

    mutable std::mutex _mutex; // the sets and the objects
    std::atomic<bool> _frozen{false};
    mutable std::array<Shard, kShards> _shards;
    // A page's set names the targets seen so far. A fork family of N
    // passes through sets of 1, 2, ... N members, so members are never
    // listed: a set is known by its size and two sums of its members'
    // hashes (the same in whatever order they came), and keeps the set it
    // was first made from and the member added to it. Set 0 is the empty set.
    struct SetKey {
        uint32_t size = 0;
        uint64_t sum1 = 0, sum2 = 0;
        bool operator==(const SetKey &) const = default;
    };
    struct SetKeyHash {
        size_t operator()(const SetKey &key) const { return static_cast<size_t>(key.sum1 ^ (key.sum2 >> 7) ^ key.size); }
    };
    struct SetEntry {
        SetKey key;
        uint32_t from = 0;
        int32_t added = 0;
    };
    std::vector<SetEntry> _sets{SetEntry{}};
    std::unordered_map<SetKey, uint32_t, SetKeyHash> _setIds{{SetKey{}, 0}};
    std::unordered_map<uint64_t, uint32_t> _transitions; // (set << 32 | pid) -> set
    std::unordered_map<uint64_t, uint64_t> _places;      // key -> lowest page noted
    std::map<std::tuple<uint64_t, uint64_t, bool>, ObjectBits> _objects; // device, inode, private
};

} // namespace vs
