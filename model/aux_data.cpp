#include "model/aux_data.h"

#include <utility>

#include "model/assert.h"

nlohmann::json VSAuxData::jsonRepresentation() const {
    return nlohmann::json(_value);
}

VSAuxDataDictionary::VSAuxDataDictionary(Entries entries) : _entries(std::move(entries)) {
    for (const auto &entry : _entries) {
        VS_ASSERT(entry.second != nullptr);
    }
}

VSAuxDataNode VSAuxDataDictionary::objectForKey(std::string_view key) const {
    auto found = _entries.find(key);
    return found == _entries.end() ? nullptr : found->second;
}

nlohmann::json VSAuxDataDictionary::jsonRepresentation() const {
    nlohmann::json object = nlohmann::json::object();
    for (const auto &[key, node] : _entries) {
        object[key] = node->jsonRepresentation();
    }
    return object;
}

std::shared_ptr<const VSAuxDataDictionary> VSAuxDataDictionary::mergeWithData(
    const VSAuxDataDictionary *other) const {
    Entries result;
    for (const auto &[key, node] : _entries) {
        VSAuxDataNode merged = mergeAuxDatum(node, other ? other->objectForKey(key) : nullptr);
        if (merged) {
            result.emplace(key, std::move(merged));
        }
    }
    if (other) {
        for (const auto &[key, node] : other->_entries) {
            if (_entries.count(key) != 0) {
                continue;
            }
            if (VSAuxDataNode merged = mergeAuxDatum(node, nullptr)) {
                result.emplace(key, std::move(merged));
            }
        }
    }
    if (result.empty()) {
        return nullptr;
    }
    return std::make_shared<const VSAuxDataDictionary>(std::move(result));
}

VSAuxDataNode VSAuxDataDictionary::mergeAuxDatum(const VSAuxDataNode &datum1, const VSAuxDataNode &datum2) {
    VS_ASSERT(datum1 != nullptr);
    VS_ASSERT_MSG(!datum2 || datum1->isContainer() == datum2->isContainer(),
                  "!datum2 || datum1.isContainer == datum2.isContainer");

    if (datum1->isContainer()) {
        const auto *first = dynamic_cast<const VSAuxDataDictionary *>(datum1.get());
        const auto *second = dynamic_cast<const VSAuxDataDictionary *>(datum2.get());
        VS_ASSERT(first != nullptr && (second != nullptr) == (datum2 != nullptr));
        return first->mergeWithData(second);
    }
    const auto *leaf1 = dynamic_cast<const VSAuxData *>(datum1.get());
    VS_ASSERT(leaf1 != nullptr);
    if (!leaf1->shouldAggregate()) {
        return nullptr; // the first side decides; its leaf stays with its process
    }
    if (!datum2) {
        return datum1;
    }
    const auto *leaf2 = dynamic_cast<const VSAuxData *>(datum2.get());
    VS_ASSERT(leaf2 != nullptr);
    return std::make_shared<const VSAuxData>(leaf1->value() + leaf2->value(), true);
}
