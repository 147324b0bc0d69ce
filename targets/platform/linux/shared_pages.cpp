#include "targets/platform/linux/shared_pages.h"

#include "targets/platform/linux/packed_numbers.h"

#include <algorithm>
#include <bit>
#include <climits>

namespace vs {

namespace {

void setBit(std::vector<uint64_t> &bits, uint64_t index) {
    if (bits.size() <= index / 64) {
        bits.resize(index / 64 + 1, 0);
    }
    bits[index / 64] |= 1ull << (index % 64);
}

// Set bits of [first, first + count).
uint64_t countBits(const std::vector<uint64_t> &bits, uint64_t first, uint64_t count) {
    uint64_t total = 0;
    const uint64_t end = std::min<uint64_t>(first + count, bits.size() * 64);
    uint64_t i = first;
    while (i < end) {
        const uint64_t word = bits[i / 64];
        const uint64_t lowBit = i % 64;
        const uint64_t highBit = std::min<uint64_t>(64, lowBit + (end - i));
        uint64_t mask = highBit == 64 ? ~0ull : (1ull << highBit) - 1;
        mask &= ~((1ull << lowBit) - 1);
        total += static_cast<uint64_t>(std::popcount(word & mask));
        i += highBit - lowBit;
    }
    return total;
}

bool testBit(const std::vector<uint64_t> &bits, uint64_t index) {
    return index / 64 < bits.size() && (bits[index / 64] >> (index % 64) & 1) != 0;
}



size_t slotOf(uint64_t key, size_t mask) {
    return static_cast<size_t>((key * 0x9E3779B97F4A7C15ull) >> 17) & mask;
}

} // namespace

namespace {

// A distance either way, its sign in the lowest bit.
void putDistance(std::vector<uint8_t> &out, uint64_t distance) {
    vs::putPackedNumber(out, (distance << 1) ^ static_cast<uint64_t>(static_cast<int64_t>(distance) >> 63));
}

uint64_t takeDistance(std::span<const uint8_t> bytes, size_t &at) {
    const uint64_t coded = vs::takePackedNumber(bytes, at);
    return (coded >> 1) ^ (0 - (coded & 1));
}

} // namespace

void encodeKeyRuns(std::span<const KeyRun> runs, std::vector<uint8_t> &out) {
    uint64_t next = 0, nextPage = 0; // the key and the page after the last run
    for (const KeyRun &run : runs) {
        putDistance(out, run.first - next);
        vs::putPackedNumber(out, run.length);
        putDistance(out, run.page - nextPage);
        next = run.first + run.length;
        nextPage = run.page + run.length;
    }
}

void decodeKeyRuns(std::span<const uint8_t> bytes, std::vector<KeyRun> &runs) {
    uint64_t next = 0, nextPage = 0;
    for (size_t at = 0; at < bytes.size();) {
        const uint64_t first = next + takeDistance(bytes, at);
        const uint64_t length = vs::takePackedNumber(bytes, at);
        const uint64_t page = nextPage + takeDistance(bytes, at);
        if (length != 0) {
            runs.push_back({first, length, page});
        }
        next = first + length;
        nextPage = page + length;
    }
}

size_t SharedPageIndex::PageTable::find(uint64_t block) const {
    if (_blocks.empty()) {
        return kNoSlot;
    }
    const size_t mask = _blocks.size() - 1;
    for (size_t slot = slotOf(block, mask);; slot = (slot + 1) & mask) {
        if (_blocks[slot] == block + 1) {
            return slot;
        }
        if (_blocks[slot] == 0) {
            return kNoSlot;
        }
    }
}

size_t SharedPageIndex::PageTable::findOrAdd(uint64_t block) {
    if ((_count + 1) * 10 > _blocks.size() * 7) {
        _grow();
    }
    const size_t mask = _blocks.size() - 1;
    size_t slot = slotOf(block, mask);
    while (_blocks[slot] != block + 1 && _blocks[slot] != 0) {
        slot = (slot + 1) & mask;
    }
    if (_blocks[slot] == 0) {
        _blocks[slot] = block + 1;
        ++_count;
    }
    return slot;
}

void SharedPageIndex::PageTable::_grow() {
    std::vector<uint64_t> blocks(std::max<size_t>(1024, _blocks.size() * 2), 0);
    std::vector<uint32_t> sets(blocks.size() * kLanes, 0);
    const size_t mask = blocks.size() - 1;
    for (size_t i = 0; i < _blocks.size(); ++i) {
        if (_blocks[i] != 0) {
            size_t slot = slotOf(_blocks[i] - 1, mask);
            while (blocks[slot] != 0) {
                slot = (slot + 1) & mask;
            }
            blocks[slot] = _blocks[i];
            std::copy_n(&_sets[i * kLanes], kLanes, &sets[slot * kLanes]);
        }
    }
    _blocks.swap(blocks);
    _sets.swap(sets);
}

void SharedPageIndex::PageTable::clear() {
    std::vector<uint64_t>().swap(_blocks);
    std::vector<uint32_t>().swap(_sets);
    _count = 0;
}

namespace {

// Two unrelated mixes of a pid (splitmix64 finalisers with other seeds).
uint64_t mixed(int32_t pid, uint64_t seed) {
    uint64_t z = static_cast<uint64_t>(static_cast<uint32_t>(pid)) + seed;
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ull;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBull;
    return z ^ (z >> 31);
}

} // namespace

uint32_t SharedPageIndex::_setWith(uint32_t set, int32_t pid) {
    const uint64_t transition = (uint64_t{set} << 32) | static_cast<uint32_t>(pid);
    if (auto found = _transitions.find(transition); found != _transitions.end()) {
        return found->second;
    }
    const SetEntry &from = _sets[set];
    if (set != 0 && from.added == pid) {
        return set; // a page the target maps twice: still one member
    }
    const SetKey key{from.key.size + 1, from.key.sum1 + mixed(pid, 0x9E3779B97F4A7C15ull),
                     from.key.sum2 + mixed(pid, 0xD1B54A32D192ED03ull)};
    auto [entry, added] = _setIds.try_emplace(key, static_cast<uint32_t>(_sets.size()));
    if (added) {
        _sets.push_back(SetEntry{key, set, pid});
    }
    _transitions.emplace(transition, entry->second);
    return entry->second;
}

template <typename Piece>
void SharedPageIndex::_forEachPiece(const KeyRun &run, Piece &&piece) {
    uint64_t key = run.first;
    uint64_t left = run.length;
    while (left > 0) {
        // Keys to the end of the chunk (unsigned arithmetic also gets the
        // last chunk of the key space right).
        const uint64_t room = (((key >> kChunkShift) + 1) << kChunkShift) - key;
        const uint64_t count = std::min(left, room);
        piece(_shardOf(key), key, count);
        key += count;
        left -= count;
    }
}

void SharedPageIndex::addPages(int32_t pid, std::span<const KeyRun> runs) {
    // The pieces of the runs, by shard.
    thread_local std::array<std::vector<KeyRun>, kShards> byShard;
    for (auto &pieces : byShard) {
        pieces.clear();
    }
    for (KeyRun run : runs) {
        if (run.first == 0 && run.length > 0) {
            // Key 0 is a hidden frame number: nobody's page.
            run.first = 1;
            run.length -= 1;
            run.page += 1;
        }
        _forEachPiece(run, [&](size_t shard, uint64_t first, uint64_t length) {
            byShard[shard].push_back({first, length, run.page + (first - run.first)});
        });
    }
    // A target takes each set it meets to one other set (itself added):
    // those steps are remembered here, away from the shared table.
    std::vector<std::pair<uint32_t, uint32_t>> steps;
    auto step = [&](uint32_t from) {
        for (const auto &[known, to] : steps) {
            if (known == from) {
                return to;
            }
        }
        std::lock_guard<std::mutex> lock(_mutex);
        const uint32_t to = _setWith(from, pid);
        steps.emplace_back(from, to);
        return to;
    };
    for (size_t shard = 0; shard < kShards; ++shard) {
        if (byShard[shard].empty()) {
            continue;
        }
        std::lock_guard<std::mutex> lock(_shards[shard].mutex);
        // Neighbouring pages are mostly in the same set: the last step first.
        uint32_t lastFrom = UINT32_MAX, lastTo = 0;
        for (const KeyRun &piece : byShard[shard]) {
            for (uint64_t key = piece.first, left = piece.length; left > 0;) {
                PageTable &table = _shards[shard].pages;
                const size_t slot = table.findOrAdd(key >> kBlockShift);
                uint32_t *sets = table.sets(slot);
                const uint64_t lane = key & (PageTable::kLanes - 1);
                const uint64_t count = std::min<uint64_t>(left, PageTable::kLanes - lane);
                for (uint64_t k = lane; k < lane + count; ++k) {
                    if (sets[k] != lastFrom) {
                        lastFrom = sets[k];
                        lastTo = step(lastFrom);
                    }
                    sets[k] = lastTo;
                }
                key += count;
                left -= count;
            }
        }
    }
}

std::optional<uint32_t> SharedPageIndex::sharedSet(uint64_t key) const {
    std::vector<SetPages> sets;
    const KeyRun run{key, 1, 0};
    sharedPages(std::span<const KeyRun>(&run, 1), sets);
    return sets.empty() ? std::nullopt : std::optional<uint32_t>(sets[0].set);
}

void SharedPageIndex::sharedPages(std::span<const KeyRun> runs, std::vector<SetPages> &out) const {
    out.clear();
    const bool frozen = _frozen.load();
    // The set of a key. Once frozen, the table of the last block asked for
    // serves its neighbours. While pages are still added: the shard's lock
    // here, the sets' lock below, never both (adding takes them nested the
    // other way round).
    uint64_t lastBlock = UINT64_MAX;
    const uint32_t *lastSets = nullptr;
    auto lookUp = [&](uint64_t key) -> uint32_t {
        const uint64_t block = key >> kBlockShift;
        const size_t lane = key & (PageTable::kLanes - 1);
        Shard &shard = _shards[_shardOf(key)];
        if (!frozen) {
            std::lock_guard<std::mutex> lock(shard.mutex);
            const size_t slot = shard.pages.find(block);
            return slot == PageTable::kNoSlot ? 0 : shard.pages.sets(slot)[lane];
        }
        if (block != lastBlock) {
            const size_t slot = shard.pages.find(block);
            lastBlock = block;
            lastSets = slot == PageTable::kNoSlot ? nullptr : shard.pages.sets(slot);
        }
        return lastSets == nullptr ? 0 : lastSets[lane];
    };
    // A region meets few sets, mostly one after the other: the last entry
    // first, then a short list.
    size_t last = SIZE_MAX;
    for (const KeyRun &run : runs) {
        const bool swapped = (run.first & kSwapKey) != 0;
        for (uint64_t i = 0; i < run.length; ++i) {
            const uint32_t set = lookUp(run.first + i);
            if (last == SIZE_MAX || out[last].set != set) {
                last = 0;
                while (last < out.size() && out[last].set != set) {
                    ++last;
                }
                if (last == out.size()) {
                    const uint64_t page = run.page + i;
                    out.push_back(SetPages{set, 0, 0, page, std::min(page, _placeOf(run.first + i, frozen))});
                }
            }
            (swapped ? out[last].swappedPages : out[last].presentPages) += 1;
        }
    }
    std::unique_lock<std::mutex> lock(_mutex, std::defer_lock);
    if (!frozen) {
        lock.lock();
    }
    std::erase_if(out, [&](const SetPages &entry) { return _sets[entry.set].key.size < 2; });
}

void SharedPageIndex::notePlace(uint64_t key, uint64_t page) {
    std::lock_guard<std::mutex> lock(_mutex);
    auto [entry, added] = _places.try_emplace(key, page);
    entry->second = std::min(entry->second, page);
}

uint64_t SharedPageIndex::_placeOf(uint64_t key, bool frozen) const {
    std::unique_lock<std::mutex> lock(_mutex, std::defer_lock);
    if (!frozen) {
        lock.lock();
    }
    const auto found = _places.find(key);
    return found == _places.end() ? UINT64_MAX : found->second;
}

std::vector<int32_t> SharedPageIndex::setMembers(uint32_t set) const {
    std::lock_guard<std::mutex> lock(_mutex);
    std::vector<int32_t> members;
    for (uint32_t at = set < _sets.size() ? set : 0; at != 0; at = _sets[at].from) {
        members.push_back(_sets[at].added);
    }
    std::sort(members.begin(), members.end());
    return members;
}

void SharedPageIndex::addWindow(const Window &window) {
    std::lock_guard<std::mutex> lock(_mutex);
    ObjectBits &object = _objects[{window.device, window.inode, window.privateMapping}];
    object.mappings += 1;
    const bool whole = window.present.empty();
    for (uint64_t i = 0; i < window.pageCount; ++i) {
        if (whole || testBit(window.present, i)) {
            setBit(object.present, window.firstPage + i);
        }
        if (testBit(window.dirty, i)) {
            setBit(object.dirty, window.firstPage + i);
        }
    }
    if (window.dirty.empty()) {
        object.unknownDirty = std::max(object.unknownDirty, window.dirtyCount);
    }
}

std::optional<ObjectPages> SharedPageIndex::objectPages(uint64_t device, uint64_t inode, bool privateMappings,
                                                       uint64_t firstPage, uint64_t pageCount) const {
    std::lock_guard<std::mutex> lock(_mutex);
    const auto found = _objects.find({device, inode, privateMappings});
    if (found == _objects.end() || found->second.mappings < 2) {
        return std::nullopt;
    }
    const ObjectBits &object = found->second;
    ObjectPages pages;
    pages.residentPages = countBits(object.present, firstPage, pageCount);
    // Where no mapping could read dirty bits, the most any one saw dirty
    // is the best lower bound there is.
    pages.dirtyPages = std::min(pages.residentPages,
                           std::max(countBits(object.dirty, firstPage, pageCount), object.unknownDirty));
    return pages;
}

void SharedPageIndex::clear() {
    std::lock_guard<std::mutex> lock(_mutex);
    _sets.assign(1, SetEntry{});
    _setIds = {{SetKey{}, 0}};
    _transitions.clear();
    _places.clear();
    _objects.clear();
    for (Shard &shard : _shards) {
        std::lock_guard<std::mutex> shardLock(shard.mutex);
        shard.pages.clear();
    }
    _frozen.store(false);
}

} // namespace vs
