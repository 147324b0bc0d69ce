#pragma once

// Auxiliary data: a tree of named numbers a target reports beside its
// categories. Leaves carry an aggregate flag that decides whether they
// survive merging into the run-wide tree: a merge keeps exactly the
// aggregating leaves, summed where both sides have them, and containers
// only while they still hold something. Nodes are immutable and shared
// between trees.

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

class VSAuxDataType {
public:
    virtual ~VSAuxDataType() = default;
    // true for a dictionary, false for a leaf.
    virtual bool isContainer() const = 0;
    // A number for a leaf, an object of the children's representations for
    // a dictionary.
    virtual nlohmann::json jsonRepresentation() const = 0;
};

using VSAuxDataNode = std::shared_ptr<const VSAuxDataType>;

class VSAuxData final : public VSAuxDataType {
public:
    VSAuxData(std::int64_t value, bool shouldAggregate)
        : _value(value), _aggregate(shouldAggregate) {}

    std::int64_t value() const { return _value; }
    bool shouldAggregate() const { return _aggregate; }

    bool isContainer() const override { return false; }
    nlohmann::json jsonRepresentation() const override;

private:
    std::int64_t _value;
    bool _aggregate;
};

class VSAuxDataDictionary final : public VSAuxDataType {
public:
    // Keys in sorted order; every node non-null.
    using Entries = std::map<std::string, VSAuxDataNode, std::less<>>;

    VSAuxDataDictionary() = default;
    explicit VSAuxDataDictionary(Entries entries);

    const Entries &entries() const { return _entries; }
    std::size_t count() const { return _entries.size(); }
    bool empty() const { return _entries.empty(); }
    // The node under key, or null.
    VSAuxDataNode objectForKey(std::string_view key) const;

    bool isContainer() const override { return true; }
    nlohmann::json jsonRepresentation() const override;

    // Merges this tree with other (which may be null). Returns null when
    // the merge keeps nothing. For every key the side that has it first
    // (this one when both do) decides whether a leaf aggregates.
    std::shared_ptr<const VSAuxDataDictionary> mergeWithData(const VSAuxDataDictionary *other) const;

    // Merges two nodes found under the same key; datum1 is never null,
    // datum2 may be. Both must have the same shape (aborts otherwise).
    // Returns the merged node or null when the key is to disappear.
    static VSAuxDataNode mergeAuxDatum(const VSAuxDataNode &datum1, const VSAuxDataNode &datum2);

private:
    Entries _entries;
};

namespace vs {

inline std::shared_ptr<const VSAuxData> makeAuxData(std::int64_t value, bool shouldAggregate) {
    return std::make_shared<const VSAuxData>(value, shouldAggregate);
}

inline std::shared_ptr<const VSAuxDataDictionary> makeAuxDictionary(VSAuxDataDictionary::Entries entries) {
    return std::make_shared<const VSAuxDataDictionary>(std::move(entries));
}

} // namespace vs
