#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "model/aux_data.h"

namespace {

using nlohmann::json;

// Trees are written as JSON: an object is a dictionary, a leaf is
// [value, aggregate], and null is the absent tree.
VSAuxDataNode nodeFrom(const json &description) {
    if (description.is_null()) {
        return nullptr;
    }
    if (!description.is_object()) {
        return vs::makeAuxData(description.at(0).get<std::int64_t>(), description.at(1).get<bool>());
    }
    VSAuxDataDictionary::Entries entries;
    for (const auto &[key, value] : description.items()) {
        entries.emplace(key, nodeFrom(value));
    }
    return vs::makeAuxDictionary(std::move(entries));
}

std::shared_ptr<const VSAuxDataDictionary> treeFrom(const json &description) {
    return std::dynamic_pointer_cast<const VSAuxDataDictionary>(nodeFrom(description));
}

json describe(const VSAuxDataNode &node) {
    if (!node) {
        return nullptr;
    }
    if (!node->isContainer()) {
        const auto &leaf = dynamic_cast<const VSAuxData &>(*node);
        return json::array({leaf.value(), leaf.shouldAggregate()});
    }
    json result = json::object();
    for (const auto &[key, child] : dynamic_cast<const VSAuxDataDictionary &>(*node).entries()) {
        result[key] = describe(child);
    }
    return result;
}

TEST(AuxDataDictionary, MergeKeepsOnlyAggregatingLeaves) {
    struct Case {
        const char *what;
        json first, second, expected;
    };
    const std::vector<Case> cases = {
        {"non-aggregating leaf with nothing", {{"phys_vestage", {100, false}}}, nullptr, nullptr},
        {"aggregating leaves summed, missing ones carried",
         {{"Kernel memory", {{"KPRVT", {10, true}}, {"KSHRD", {5, true}}}}},
         {{"Kernel memory", {{"KPRVT", {-17, true}}}}},
         {{"Kernel memory", {{"KPRVT", {-7, true}}, {"KSHRD", {5, true}}}}}},
        {"container of non-aggregating leaves disappears with its key",
         {{"Maps", {{"a", {1, false}}, {"b", {2, false}}}}, {"K", {1, true}}}, nullptr, {{"K", {1, true}}}},
        {"first side aggregates, second does not: summed and aggregating", {{"x", {2, true}}}, {{"x", {3, false}}},
         {{"x", {5, true}}}},
        {"first side does not aggregate: key dropped", {{"x", {3, false}}}, {{"x", {2, true}}}, nullptr},
        {"nested container only in the argument", {{"a", {1, true}}},
         {{"Kernel memory", {{"KPRVT", {4, true}}, {"peak", {9, false}}}}},
         {{"a", {1, true}}, {"Kernel memory", {{"KPRVT", {4, true}}}}}},
        {"empty with empty", json::object(), json::object(), nullptr},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const auto first = treeFrom(c.first);
        const auto second = treeFrom(c.second);
        const json before = describe(second);
        EXPECT_EQ(describe(first->mergeWithData(second.get())), c.expected);
        EXPECT_EQ(describe(second), before) << "merging must not change its argument";
    }
    const VSAuxDataNode leaf = vs::makeAuxData(7, true);
    EXPECT_EQ(VSAuxDataDictionary::mergeAuxDatum(leaf, nullptr), leaf) << "kept itself, not a copy";
}

} // namespace
