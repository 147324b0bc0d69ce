#include "targets/platform/linux/object_ids.h"

#include "model/assert.h"

namespace vs {

uint32_t ObjectIdTable::idForFile(uint64_t device, uint64_t inode) {
    std::lock_guard<std::mutex> lock(_mutex);
    auto [it, inserted] = _files.try_emplace(FileKey{device, inode}, 0);
    if (inserted) {
        it->second = _nextLocked();
    }
    return it->second;
}

uint32_t ObjectIdTable::idForName(std::string_view name) {
    std::lock_guard<std::mutex> lock(_mutex);
    auto [it, inserted] = _names.try_emplace(std::string(name), 0);
    if (inserted) {
        it->second = _nextLocked();
    }
    return it->second;
}

uint32_t ObjectIdTable::freshId() {
    std::lock_guard<std::mutex> lock(_mutex);
    return _nextLocked();
}

uint32_t ObjectIdTable::_nextLocked() {
    VS_ASSERT(_last != UINT32_MAX);
    return ++_last;
}

ObjectIdTable &ObjectIdTable::shared() {
    static ObjectIdTable table;
    return table;
}

} // namespace vs
