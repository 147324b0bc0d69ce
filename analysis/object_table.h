#pragma once

// The driver's memory objects of one collection, by object key. A live run
// files tens of thousands of objects, most of them under a key of their
// own: the table owns them in the order they were created and finds them
// through a flat open-addressing index of positions (no node per object).

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "model/memory_object.h"

namespace vs {

class MemoryObjectTable {
public:
    using Objects = std::vector<std::unique_ptr<VSMemoryObject>>;

    // The object filed under `key`, created empty on first use.
    VSMemoryObject &objectFor(std::uint64_t key) {
        if ((_keys.size() + 1) * 2 > _slots.size()) {
            std::size_t slots = std::max<std::size_t>(64, _slots.size() * 2);
            while (slots < (_keys.size() + 1) * 2) {
                slots *= 2;
            }
            _rebuild(slots);
        }
        const std::size_t mask = _slots.size() - 1;
        std::size_t i = _slotFor(key, mask);
        for (; _slots[i] != 0; i = (i + 1) & mask) {
            if (_keys[_slots[i] - 1] == key) {
                return *_objects[_slots[i] - 1];
            }
        }
        _keys.push_back(key);
        _objects.push_back(std::make_unique<VSMemoryObject>());
        _slots[i] = static_cast<std::uint32_t>(_keys.size());
        return *_objects.back();
    }

    // Room for `count` objects without growing again.
    void reserve(std::size_t count) {
        _keys.reserve(count);
        _objects.reserve(count);
        std::size_t slots = 64;
        while (slots < count * 2) {
            slots *= 2;
        }
        if (slots > _slots.size()) {
            _rebuild(slots);
        }
    }

    std::size_t size() const { return _objects.size(); }
    bool empty() const { return _objects.empty(); }
    // The objects in the order they were created.
    const Objects &objects() const { return _objects; }

    // Hands every object over and leaves the table empty.
    Objects release() {
        Objects objects = std::move(_objects);
        clear();
        return objects;
    }

    // Gives the index back once no more objects are looked up (it is built
    // again by the next lookup): the objects stay.
    void dropIndex() { std::vector<std::uint32_t>().swap(_slots); }

    void clear() {
        _objects.clear();
        _keys.clear();
        _slots.clear();
    }

private:
    static std::size_t _slotFor(std::uint64_t key, std::size_t mask) {
        return static_cast<std::size_t>((key * 0x9E3779B97F4A7C15ull) >> 32) & mask;
    }

    void _rebuild(std::size_t slots) {
        _slots.assign(slots, 0);
        const std::size_t mask = slots - 1;
        for (std::size_t index = 0; index < _keys.size(); ++index) {
            std::size_t i = _slotFor(_keys[index], mask);
            while (_slots[i] != 0) {
                i = (i + 1) & mask;
            }
            _slots[i] = static_cast<std::uint32_t>(index + 1);
        }
    }

    Objects _objects;
    std::vector<std::uint64_t> _keys; // parallel to _objects
    // Power-of-two index at most half full: 0 free, else a position + 1.
    std::vector<std::uint32_t> _slots;
};

} // namespace vs
