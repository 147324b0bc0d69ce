#pragma once

// An insertion-ordered set of non-owning pointers. Regions and memory
// objects are collected into sets that are later iterated for the report;
// keeping the order of insertion makes every run over the same input print
// the same thing, which a hash set would not.
//
// A run holds one set per memory object, and most objects have a single
// region: a set of one keeps its member inline, with no allocation, and the
// whole set is two words. Larger sets keep their members in a list beside
// it; small ones are searched linearly, and once a set grows past that an
// open-addressing index of the members (a flat table, no node per member)
// is built.

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <utility>
#include <vector>

#include "model/assert.h"

namespace vs {

template <typename T>
class PointerSet {
public:
    using const_iterator = T *const *;

    PointerSet() = default;
    PointerSet(const PointerSet &other)
        : _one(other._one), _large(other._large ? std::make_unique<Large>(*other._large) : nullptr) {}
    PointerSet &operator=(const PointerSet &other) {
        if (this != &other) {
            _one = other._one;
            _large = other._large ? std::make_unique<Large>(*other._large) : nullptr;
        }
        return *this;
    }
    PointerSet(PointerSet &&other) noexcept
        : _one(std::exchange(other._one, nullptr)), _large(std::move(other._large)) {}
    PointerSet &operator=(PointerSet &&other) noexcept {
        if (this != &other) {
            _one = std::exchange(other._one, nullptr);
            _large = std::move(other._large);
        }
        return *this;
    }

    // Adds p unless it is already present. Returns true when it was added.
    bool insert(T *p) { return insertIndex(p).second; }

    // Adds p unless it is already present. Returns p's position in the
    // order of first addition, and whether it was added now.
    std::pair<std::size_t, bool> insertIndex(T *p) {
        VS_ASSERT(p != nullptr);
        if (const std::size_t found = indexOf(p); found != kNotFound) {
            return {found, false};
        }
        appendNew(p);
        return {size() - 1, true};
    }

    // Adds p, which the caller knows is not a member yet: no lookup. The
    // index, if any, catches up at the next lookup.
    void appendNew(T *p) {
        VS_ASSERT(p != nullptr);
        if (!_large && _one == nullptr) {
            _one = p;
            return;
        }
        _makeLarge(4).items.push_back(p);
    }

    static constexpr std::size_t kNotFound = static_cast<std::size_t>(-1);

    // p's position in the order of first addition, or kNotFound.
    std::size_t indexOf(const T *p) const {
        if (_large && _large->items.size() > kLinearLimit) {
            _large->catchUp();
            const std::vector<std::uint32_t> &slots = _large->slots;
            const std::size_t mask = slots.size() - 1;
            for (std::size_t i = _slotFor(p, mask);; i = (i + 1) & mask) {
                const std::uint32_t slot = slots[i];
                if (slot == 0) {
                    return kNotFound;
                }
                if (_large->items[slot - 1] == p) {
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
        if (_large && slots <= _large->slots.size()) {
            return;
        }
        Large &large = _makeLarge(count);
        large.items.reserve(count);
        large.rebuildIndex(slots);
    }

    // Adds every member of other, keeping other's order for the new ones.
    void unionWith(const PointerSet &other) {
        for (T *p : other) {
            insert(p);
        }
    }

    std::size_t size() const { return _large ? _large->items.size() : (_one != nullptr ? 1 : 0); }
    bool empty() const { return size() == 0; }
    const_iterator begin() const { return _large ? _large->items.data() : &_one; }
    const_iterator end() const { return begin() + size(); }
    // The members in the order they were first added.
    std::span<T *const> items() const { return {begin(), size()}; }

private:
    static constexpr std::size_t kLinearLimit = 16;

    static std::size_t _slotFor(const T *p, std::size_t mask) {
        const auto bits = static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(p));
        return static_cast<std::size_t>(((bits >> 3) * 0x9E3779B97F4A7C15ull) >> 32) & mask;
    }

    // The members of a set of more than one, and their index. The index is
    // made when a lookup first needs it and follows the list lazily: sets
    // that are only filled with known new members and then read never
    // build one.
    struct Large {
        std::vector<T *> items;
        // Empty, or a power-of-two table at most half full: 0 is a free
        // slot, anything else a position in items plus one.
        std::vector<std::uint32_t> slots;
        // How many of items are placed in slots.
        std::size_t indexed = 0;

        void place(std::size_t index) {
            const std::size_t mask = slots.size() - 1;
            std::size_t i = _slotFor(items[index], mask);
            while (slots[i] != 0) {
                i = (i + 1) & mask;
            }
            slots[i] = static_cast<std::uint32_t>(index + 1);
        }

        void rebuildIndex(std::size_t count) {
            slots.assign(count, 0);
            for (std::size_t index = 0; index < items.size(); ++index) {
                place(index);
            }
            indexed = items.size();
        }

        // Brings the index up to the list, doubling the table while it
        // would be more than half full.
        void catchUp() {
            if (indexed == items.size() && !slots.empty()) {
                return;
            }
            std::size_t count = slots.empty() ? 64 : slots.size();
            while (count < items.size() * 2) {
                count *= 2;
            }
            if (count != slots.size()) {
                rebuildIndex(count);
                return;
            }
            for (; indexed < items.size(); ++indexed) {
                place(indexed);
            }
        }
    };

    // The list of members, made on the second one (the first moves into it).
    Large &_makeLarge(std::size_t capacity) {
        if (!_large) {
            _large = std::make_unique<Large>();
            _large->items.reserve(capacity);
            if (_one != nullptr) {
                _large->items.push_back(_one);
            }
        }
        return *_large;
    }

    // The only member while there is no list; not read once there is one.
    T *_one = nullptr;
    std::unique_ptr<Large> _large;
};

} // namespace vs
