#pragma once

// An insertion-ordered set of non-owning pointers. Regions and memory
// objects are collected into sets that are later iterated for the report;
// keeping the order of insertion makes every run over the same input print
// the same thing, which a hash set would not. Small sets (the common case:
// most objects have one or two regions) are searched linearly; a hash index
// is built only once a set grows.

#include <cstddef>
#include <unordered_set>
#include <vector>

namespace vs {

template <typename T>
class PointerSet {
public:
    using const_iterator = typename std::vector<T *>::const_iterator;

    // Adds p unless it is already present. Returns true when it was added.
    bool insert(T *p) {
        if (contains(p)) {
            return false;
        }
        _items.push_back(p);
        if (!_index.empty()) {
            _index.insert(p);
        } else if (_items.size() > kLinearLimit) {
            _index.insert(_items.begin(), _items.end());
        }
        return true;
    }

    bool contains(const T *p) const {
        if (!_index.empty()) {
            return _index.count(const_cast<T *>(p)) != 0;
        }
        for (T *q : _items) {
            if (q == p) {
                return true;
            }
        }
        return false;
    }

    // Adds every member of other, keeping other's order for the new ones.
    void unionWith(const PointerSet &other) {
        for (T *p : other._items) {
            insert(p);
        }
    }

    std::size_t size() const { return _items.size(); }
    bool empty() const { return _items.empty(); }
    const_iterator begin() const { return _items.begin(); }
    const_iterator end() const { return _items.end(); }
    // The members in the order they were first added.
    const std::vector<T *> &items() const { return _items; }

private:
    static constexpr std::size_t kLinearLimit = 16;
    std::vector<T *> _items;
    std::unordered_set<T *> _index;
};

} // namespace vs
