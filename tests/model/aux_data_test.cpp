#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "model/aux_data.h"

namespace {

using nlohmann::json;

// Trees are written as JSON: an object is a dictionary, a leaf is
// [value, aggregate], and null is the absent tree.
std::shared_ptr<const VSAuxDataDictionary> treeFrom(const json &description);

VSAuxDataNode nodeFrom(const json &description) {
    if (description.is_object()) {
        return treeFrom(description);
    }
    return vs::makeAuxData(description.at(0).get<std::int64_t>(), description.at(1).get<bool>());
}

std::shared_ptr<const VSAuxDataDictionary> treeFrom(const json &description) {
    if (description.is_null()) {
        return nullptr;
    }
    VSAuxDataDictionary::Entries entries;
    for (const auto &[key, value] : description.items()) {
        entries.emplace(key, nodeFrom(value));
    }
    return vs::makeAuxDictionary(std::move(entries));
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

struct MergeCase {
    const char *what;
    json first;
    json second;
    json expected;
};

TEST(AuxDataDictionary, MergeKeepsOnlyAggregatingLeaves) {
    const std::vector<MergeCase> cases = {
        {"non-aggregating leaf with nothing", {{"phys_vestage", {100, false}}}, nullptr, nullptr},
        {"aggregating leaves summed, missing ones carried",
         {{"Kernel memory", {{"KPRVT", {10, true}}, {"KSHRD", {5, true}}}}},
         {{"Kernel memory", {{"KPRVT", {7, true}}}}},
         {{"Kernel memory", {{"KPRVT", {17, true}}, {"KSHRD", {5, true}}}}}},
        {"key only in the argument carried unchanged",
         {{"phys_vestage", {1, false}}},
         {{"KPRVT", {3, true}}},
         {{"KPRVT", {3, true}}}},
        {"container of non-aggregating leaves disappears with its key",
         {{"Maps", {{"a", {1, false}}, {"b", {2, false}}}}, {"K", {1, true}}},
         nullptr,
         {{"K", {1, true}}}},
        {"first side aggregates, second does not: summed and aggregating",
         {{"x", {2, true}}},
         {{"x", {3, false}}},
         {{"x", {5, true}}}},
        {"first side does not aggregate: key dropped", {{"x", {3, false}}}, {{"x", {2, true}}}, nullptr},
        {"nested container only in the argument",
         {{"a", {1, true}}},
         {{"Kernel memory", {{"KPRVT", {4, true}}, {"peak", {9, false}}}}},
         {{"a", {1, true}}, {"Kernel memory", {{"KPRVT", {4, true}}}}}},
        {"signed values", {{"x", {-5, true}}}, {{"x", {3, true}}}, {{"x", {-2, true}}}},
        {"empty with empty", json::object(), json::object(), nullptr},
        {"empty with nothing", json::object(), nullptr, nullptr},
    };
    for (const MergeCase &c : cases) {
        SCOPED_TRACE(c.what);
        auto first = treeFrom(c.first);
        auto second = treeFrom(c.second);
        const json before = describe(second);
        EXPECT_EQ(describe(first->mergeWithData(second.get())), c.expected);
        EXPECT_EQ(describe(second), before) << "merging must not change its argument";
    }
}

// The run-wide tree: fold every process's tree into the running result.
TEST(AuxDataDictionary, FoldOverProcesses) {
    const std::vector<json> processes = {
        {{"phys_vestage", {100, false}},
         {"phys_vestage_peak", {200, false}},
         {"Kernel memory", {{"KPRVT", {10, true}}, {"KSHRD", {0, true}}}}},
        {{"Maps", {{"MemTotal", {1 << 30, false}}, {"VmallocUsed", {4096, false}}}}},
        {{"phys_vestage", {50, false}},
         {"phys_vestage_peak", {60, false}},
         {"Kernel memory", {{"KPRVT", {32, true}}, {"KSHRD", {8, true}}}}},
    };
    std::shared_ptr<const VSAuxDataDictionary> global;
    for (const json &process : processes) {
        global = treeFrom(process)->mergeWithData(global.get());
    }
    EXPECT_EQ(describe(global), json({{"Kernel memory", {{"KPRVT", {42, true}}, {"KSHRD", {8, true}}}}}));
}

TEST(AuxDataDictionary, AggregatingLeafWithNothingIsKeptItself) {
    const VSAuxDataNode leaf = vs::makeAuxData(7, true);
    EXPECT_EQ(VSAuxDataDictionary::mergeAuxDatum(leaf, nullptr), leaf);
    EXPECT_EQ(VSAuxDataDictionary::mergeAuxDatum(vs::makeAuxData(7, false), leaf), nullptr);
}

TEST(AuxDataDictionaryDeathTest, MergingALeafWithAContainerAborts) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const VSAuxDataNode leaf = vs::makeAuxData(1, true);
    const VSAuxDataNode container = treeFrom({{"a", {1, true}}});
    EXPECT_DEATH(VSAuxDataDictionary::mergeAuxDatum(leaf, container),
                 "!datum2 \\|\\| datum1\\.isContainer == datum2\\.isContainer");
    EXPECT_DEATH(treeFrom({{"k", {1, true}}})->mergeWithData(treeFrom({{"k", {{"a", {1, true}}}}}).get()),
                 "datum1\\.isContainer");
}

TEST(AuxData, JsonRepresentation) {
    struct Case {
        json tree;
        std::string expected;
    };
    const std::vector<Case> cases = {
        {{{"Maps", {{"a", {1, false}}}}}, R"({"Maps":{"a":1}})"},
        {json::object(), "{}"},
        {{{"Kernel memory", {{"KPRVT", {-1, true}}, {"KSHRD", {std::numeric_limits<std::int64_t>::max(), true}}}},
          {"phys_vestage", {std::numeric_limits<std::int64_t>::min(), false}},
          {"empty", json::object()}},
         R"({"Kernel memory":{"KPRVT":-1,"KSHRD":9223372036854775807},"empty":{},)"
         R"("phys_vestage":-9223372036854775808})"},
    };
    for (const Case &c : cases) {
        EXPECT_EQ(treeFrom(c.tree)->jsonRepresentation().dump(), c.expected);
    }
    const json leaf = VSAuxData(-3, true).jsonRepresentation();
    EXPECT_TRUE(leaf.is_number_integer());
    EXPECT_FALSE(leaf.is_number_unsigned());
    EXPECT_FALSE(VSAuxData(1, true).isContainer());
    EXPECT_TRUE(VSAuxDataDictionary().isContainer());
}

} // namespace
