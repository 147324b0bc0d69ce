#pragma once

// An insertion-ordered set of non-owning pointers. Regions and memory
// objects are collected into sets that are later iterated for the report;
// keeping the order of insertion makes every run over the same input print
// the same thing, which a hash set would not.
//
// A run holds one set per memory object, and most objects have a single
// region: a set of one keeps its member inline, with no allocation. Small
// sets are searched linearly; once a set grows past that, an open-addressing
// index of the members (a flat table, no node per member) is built beside
// them.

#include <cstddef>
#include <cstdint>
#include <span>
#include <utility>
#include <vector>

#include "model/assert.h"

namespace vs {

template <typename T>
class PointerSet {
public:
    using const_iterator = T *const *;

    // Adds p unless it is already present. Returns true when it was added.
    bool insert(T *p) { return insertIndex(p).second; }

    // Adds p unless it is already present. Returns p's position in the
    // order of first addition, and whether it was added now.
    std::pair<std::size_t, bool> insertIndex(T *p) {
        VS_ASSERT(p != nullptr);
        if (const std::size_t found = indexOf(p); found != kNotFound) {
            return {found, false};
        }
        if (_more.empty() && _slots.empty() && _one == nullptr) {
            _one = p;
            return {0, true};
        }
        if (_more.empty() && _one != nullptr) {
            _more.reserve(4);
            _more.push_back(_one);
        }
        _more.push_back(p);
        const std::size_t index = _more.size() - 1;
        if (!_slots.empty()) {
            if (_more.size() * 2 > _slots.size()) {
                _rebuildIndex(_slots.size() * 2);
            } else {
                _place(index);
            }
        } else if (_more.size() > kLinearLimit) {
            _rebuildIndex(64);
        }
        return {index, true};
    }

    static constexpr std::size_t kNotFound = static_cast<std::size_t>(-1);

    // p's position in the order of first addition, or kNotFound.
    std::size_t indexOf(const T *p) const {
        if (!_slots.empty()) {
            const std::size_t mask = _slots.size() - 1;
            for (std::size_t i = _slotFor(p, mask);; i = (i + 1) & mask) {
                const std::uint32_t slot = _slots[i];
                if (slot == 0) {
                    return kNotFound;
                }
                if (_more[slot - 1] == p) {
                    return slot - 1;
                }
            }
        }
        const std::size_t count = size();
        const_iterator members = begin();
        for (std::size_t i = 0; i < count; ++i) {
            if (members[i] == p) {
                return i;
            }
        }
        return kNotFound;
    }

    bool contains(const T *p) const { return indexOf(p) != kNotFound; }

    // Room for `count` members without growing the index again.
    void reserve(std::size_t count) {
        if (count <= kLinearLimit) {
            return;
        }
        std::size_t slots = 64;
        while (slots < count * 2) {
            slots *= 2;
        }
        if (slots <= _slots.size()) {
            return;
        }
        if (_more.empty() && _one != nullptr) {
            _more.push_back(_one);
        }
        _more.reserve(count);
        _rebuildIndex(slots);
    }

    // Adds every member of other, keeping other's order for the new ones.
    void unionWith(const PointerSet &other) {
        for (T *p : other) {
            insert(p);
        }
    }

    std::size_t size() const { return _more.empty() ? (_one != nullptr ? 1 : 0) : _more.size(); }
    bool empty() const { return size() == 0; }
    const_iterator begin() const { return _more.empty() ? &_one : _more.data(); }
    const_iterator end() const { return begin() + size(); }
    // The members in the order they were first added.
    std::span<T *const> items() const { return {begin(), size()}; }

private:
    static constexpr std::size_t kLinearLimit = 16;

    static std::size_t _slotFor(const T *p, std::size_t mask) {
        const auto bits = static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(p));
        return static_cast<std::size_t>(((bits >> 3) * 0x9E3779B97F4A7C15ull) >> 32) & mask;
    }

    void _place(std::size_t index) {
        const std::size_t mask = _slots.size() - 1;
        std::size_t i = _slotFor(_more[index], mask);
        while (_slots[i] != 0) {
            i = (i + 1) & mask;
        }
        _slots[i] = static_cast<std::uint32_t>(index + 1);
    }

    void _rebuildIndex(std::size_t slots) {
        _slots.assign(slots, 0);
        for (std::size_t index = 0; index < _more.size(); ++index) {
            _place(index);
        }
    }

    // The only member while there is at most one and no index; afterwards
    // the members live in _more and _one is no longer read.
    T *_one = nullptr;
    std::vector<T *> _more;
    // Empty, or a power-of-two table at most half full: 0 is a free slot,
    // anything else a position in _more plus one.
    std::vector<std::uint32_t> _slots;
};

} // namespace vs
