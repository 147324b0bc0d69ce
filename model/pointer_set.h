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
#include <vector>

#include "model/assert.h"

namespace vs {

template <typename T>
class PointerSet {
public:
    using const_iterator = T *const *;

    // Adds p unless it is already present. Returns true when it was added.
    bool insert(T *p) {
        VS_ASSERT(p != nullptr);
        if (contains(p)) {
            return false;
        }
        if (_more.empty() && _one == nullptr) {
            _one = p;
            return true;
        }
        if (_more.empty()) {
            _more.reserve(4);
            _more.push_back(_one);
        }
        _more.push_back(p);
        if (!_slots.empty()) {
            if ((_more.size() * 2) > _slots.size()) {
                _rebuildIndex(_slots.size() * 2);
            } else {
                _place(p);
            }
        } else if (_more.size() > kLinearLimit) {
            _rebuildIndex(64);
        }
        return true;
    }

    bool contains(const T *p) const {
        if (!_slots.empty()) {
            const std::size_t mask = _slots.size() - 1;
            for (std::size_t i = _slotFor(p, mask);; i = (i + 1) & mask) {
                if (_slots[i] == p) {
                    return true;
                }
                if (_slots[i] == nullptr) {
                    return false;
                }
            }
        }
        for (T *q : *this) {
            if (q == p) {
                return true;
            }
        }
        return false;
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

    void _place(T *p) {
        const std::size_t mask = _slots.size() - 1;
        std::size_t i = _slotFor(p, mask);
        while (_slots[i] != nullptr) {
            i = (i + 1) & mask;
        }
        _slots[i] = p;
    }

    void _rebuildIndex(std::size_t slots) {
        _slots.assign(slots, nullptr);
        for (T *q : _more) {
            _place(q);
        }
    }

    // The only member while there is at most one; afterwards the members
    // live in _more and _one is no longer read.
    T *_one = nullptr;
    std::vector<T *> _more;
    // Empty, or a power-of-two table at most half full (null = free slot).
    std::vector<T *> _slots;
};

} // namespace vs
