#include "targets/platform/linux/shared_pages.h"

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

const uint32_t *SharedPageIndex::PageTable::find(uint64_t key) const {
    if (_keys.empty()) {
        return nullptr;
    }
    const size_t mask = _keys.size() - 1;
    for (size_t slot = slotOf(key, mask);; slot = (slot + 1) & mask) {
        if (_keys[slot] == key) {
            return &_values[slot];
        }
        if (_keys[slot] == 0) {
            return nullptr;
        }
    }
}

uint32_t *SharedPageIndex::PageTable::find(uint64_t key) {
    return const_cast<uint32_t *>(static_cast<const PageTable *>(this)->find(key));
}

uint32_t &SharedPageIndex::PageTable::operator[](uint64_t key) {
    if ((_count + 1) * 2 > _keys.size()) {
        _grow();
    }
    const size_t mask = _keys.size() - 1;
    size_t slot = slotOf(key, mask);
    while (_keys[slot] != key && _keys[slot] != 0) {
        slot = (slot + 1) & mask;
    }
    if (_keys[slot] == 0) {
        _keys[slot] = key;
        _values[slot] = 0;
        ++_count;
    }
    return _values[slot];
}

void SharedPageIndex::PageTable::_grow() {
    std::vector<uint64_t> keys(std::max<size_t>(1024, _keys.size() * 2), 0);
    std::vector<uint32_t> values(keys.size(), 0);
    const size_t mask = keys.size() - 1;
    for (size_t i = 0; i < _keys.size(); ++i) {
        if (_keys[i] != 0) {
            size_t slot = slotOf(_keys[i], mask);
            while (keys[slot] != 0) {
                slot = (slot + 1) & mask;
            }
            keys[slot] = _keys[i];
            values[slot] = _values[i];
        }
    }
    _keys.swap(keys);
    _values.swap(values);
}

void SharedPageIndex::PageTable::clear() {
    std::vector<uint64_t>().swap(_keys);
    std::vector<uint32_t>().swap(_values);
    _count = 0;
}

uint32_t SharedPageIndex::_internSet(std::vector<int32_t> members) {
    auto [entry, added] = _setIds.try_emplace(members, static_cast<uint32_t>(_sets.size()));
    if (added) {
        _sets.push_back(std::move(members));
    }
    return entry->second;
}

uint32_t SharedPageIndex::_setWith(uint32_t set, int32_t pid) {
    const uint64_t transition = (uint64_t{set} << 32) | static_cast<uint32_t>(pid);
    if (auto found = _transitions.find(transition); found != _transitions.end()) {
        return found->second;
    }
    std::vector<int32_t> members = _sets[set];
    const auto at = std::lower_bound(members.begin(), members.end(), pid);
    uint32_t result = set;
    if (at == members.end() || *at != pid) {
        members.insert(at, pid);
        result = _internSet(std::move(members));
    }
    _transitions.emplace(transition, result);
    return result;
}

void SharedPageIndex::addPages(int32_t pid, std::span<const uint64_t> keys) {
    std::lock_guard<std::mutex> lock(_mutex);
    // Neighbouring pages are mostly in the same set: remember the last step.
    uint32_t lastFrom = UINT32_MAX, lastTo = 0;
    for (const uint64_t key : keys) {
        if (key == 0) {
            continue;
        }
        uint32_t &set = _pages[key];
        if (set != lastFrom) {
            lastFrom = set;
            lastTo = _setWith(set, pid);
        }
        set = lastTo;
    }
}

std::optional<uint32_t> SharedPageIndex::sharedSet(uint64_t key) const {
    std::lock_guard<std::mutex> lock(_mutex);
    const uint32_t *found = _pages.find(key);
    if (found == nullptr || _sets[*found].size() < 2) {
        return std::nullopt;
    }
    return *found;
}

void SharedPageIndex::sharedSets(std::span<const uint64_t> keys, std::vector<uint32_t> &sets) const {
    sets.assign(keys.size(), kNoSet);
    std::lock_guard<std::mutex> lock(_mutex);
    for (size_t i = 0; i < keys.size(); ++i) {
        const uint32_t *found = _pages.find(keys[i]);
        if (found != nullptr && _sets[*found].size() >= 2) {
            sets[i] = *found;
        }
    }
}

std::vector<int32_t> SharedPageIndex::setMembers(uint32_t set) const {
    std::lock_guard<std::mutex> lock(_mutex);
    return set < _sets.size() ? _sets[set] : std::vector<int32_t>{};
}

void SharedPageIndex::addWindow(const Window &window) {
    std::lock_guard<std::mutex> lock(_mutex);
    ObjectBits &object = _objects[{window.device, window.inode}];
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

std::optional<SharedPageIndex::Pages> SharedPageIndex::objectPages(uint64_t device, uint64_t inode,
                                                                   uint64_t firstPage, uint64_t pageCount) const {
    std::lock_guard<std::mutex> lock(_mutex);
    const auto found = _objects.find({device, inode});
    if (found == _objects.end() || found->second.mappings < 2) {
        return std::nullopt;
    }
    const ObjectBits &object = found->second;
    Pages pages;
    pages.resident = countBits(object.present, firstPage, pageCount);
    // Where no mapping could read dirty bits, the most any one saw dirty
    // is the best lower bound there is.
    pages.dirty = std::min(pages.resident,
                           std::max(countBits(object.dirty, firstPage, pageCount), object.unknownDirty));
    return pages;
}

void SharedPageIndex::clear() {
    std::lock_guard<std::mutex> lock(_mutex);
    _sets.assign(1, {});
    _setIds = {{{}, 0}};
    _transitions.clear();
    _pages.clear();
    _objects.clear();
}

} // namespace vs
