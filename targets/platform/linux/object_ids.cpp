#include "targets/platform/linux/object_ids.h"

#include "model/assert.h"

namespace vs {

uint32_t ObjectIdTable::_idFor(Key key) {
    std::lock_guard<std::mutex> lock(_mutex);
    auto [it, inserted] = _ids.try_emplace(std::move(key), 0);
    if (inserted) {
        VS_ASSERT(_last != UINT32_MAX);
        it->second = ++_last;
        _keys.emplace(it->second, it->first);
    }
    return it->second;
}

uint32_t ObjectIdTable::idForFile(uint64_t device, uint64_t inode) {
    return _idFor(Key{Kind::File, device, inode, 0, {}});
}

uint32_t ObjectIdTable::idForFileWindow(uint64_t device, uint64_t inode, uint64_t offset) {
    return _idFor(Key{Kind::FileWindow, device, inode, offset, {}});
}

uint32_t ObjectIdTable::idForName(std::string_view name) {
    return _idFor(Key{Kind::Name, 0, 0, 0, std::string(name)});
}

uint32_t ObjectIdTable::idForFrameSet(uint32_t set, uint64_t address) {
    return _idFor(Key{Kind::FrameSet, set, address, 0, {}});
}

uint32_t ObjectIdTable::freshId() {
    std::lock_guard<std::mutex> lock(_mutex);
    VS_ASSERT(_last != UINT32_MAX);
    return ++_last;
}

std::optional<std::string> ObjectIdTable::stableIdentity(uint32_t id) const {
    std::lock_guard<std::mutex> lock(_mutex);
    const auto found = _keys.find(id);
    if (found == _keys.end()) {
        return std::nullopt;
    }
    const auto &[kind, a, b, c, name] = found->second;
    const std::string file =
        "file " + std::to_string(a >> 32) + ":" + std::to_string(a & 0xFFFFFFFFu) + " inode " + std::to_string(b);
    switch (kind) {
    case Kind::File:
        return file;
    case Kind::FileWindow:
        return file + " offset " + std::to_string(c);
    case Kind::Name:
        return "kernel mapping " + name;
    case Kind::FrameSet:
        break;
    }
    return std::nullopt;
}

ObjectIdTable &ObjectIdTable::shared() {
    static ObjectIdTable table;
    return table;
}

} // namespace vs
