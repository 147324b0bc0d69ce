// The heapfile document: every unusable file gives an error naming the problem; written text reads back unchanged.

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "model/memory_region.h"
#include "tests/targets/heapfile_test_support.h"

namespace {

using nlohmann::json;
using vs::testing::region;

json validDocument() {
    return json::parse(vs::heapfileText(vs::testing::snapshotOf(
        {region({0x400000, 0x2000, "__TEXT", "/usr/bin/worker", true, 0, 0x2000}),
         region({0x600000, 0x4000, "sbrk", {}, false, 5, 0x3000, 0x3000, 0x1000})})));
}

std::string with(const char *pointer, const json &value) {
    json document = validDocument();
    document[json::json_pointer(pointer)] = value;
    return document.dump();
}

std::string without(const char *pointer) {
    json document = validDocument();
    const json::json_pointer path(pointer);
    document[path.parent_pointer()].erase(path.back());
    return document.dump();
}

TEST(HeapfileFormatTest, BadFilesAreRefusedWithTheirProblemNamed) {
    using namespace vs;
    const std::string whole = validDocument().dump(2);
    const std::vector<std::tuple<std::string, int64_t, std::string>> cases = {
        {"", kHeapfileErrorEmpty, "empty"}, {whole.substr(0, whole.size() / 2), kHeapfileErrorSyntax, "truncated"},
        {"MALLOC_TINY 0x1000 rw-", kHeapfileErrorSyntax, "syntax error at byte"},
        {std::string("\x7f" "ELF\x02\x01\x01\0\0\0", 10), kHeapfileErrorSyntax, "not a JSON document"},
        {"[1, 2]", kHeapfileErrorNotHeapfile, "not a JSON object"},
        {std::string(10000, '[') + std::string(10000, ']'), kHeapfileErrorNotHeapfile, "nested"},
        {without("/format"), kHeapfileErrorNotHeapfile, "no \"format\""},
        {with("/format", "other-snapshot"), kHeapfileErrorNotHeapfile, "\"other-snapshot\""},
        {with("/version", 3), kHeapfileErrorVersion, "version 3 is not supported"},
        {with("/version", 0), kHeapfileErrorVersion, "version 0 is not supported"},
        {without("/pid"), kHeapfileErrorMissingKey, "missing key \"pid\""},
        {with("/pid", -3), kHeapfileErrorBadValue, "\"pid\" is negative"},
        {with("/pid", 4294967296ull), kHeapfileErrorBadValue, "above its limit"},
        {with("/pageSize", 3000), kHeapfileErrorBadValue, "\"pageSize\" is 3000, not a power of two"},
        {with("/pageSize", 4096.5), kHeapfileErrorBadValue, "\"pageSize\" is not a non-negative integer"},
        {with("/pointerWidth", 48), kHeapfileErrorBadValue, "expected 32 or 64"},
        {with("/breakDownPhysVestage", "yes"), kHeapfileErrorBadValue, "not true or false"},
        {with("/regions/1", 7), kHeapfileErrorBadValue, "region 1: not a JSON object"},
        {without("/regions/0/address"), kHeapfileErrorMissingKey, "region 0: missing key \"address\""},
        {with("/regions/0/address", "0xZZ"), kHeapfileErrorBadValue, "\"address\" is not a number"},
        {with("/regions/1/address", "0xfffffffffffff000"), kHeapfileErrorBadValue, "ends below its start"},
        {with("/regions/1/length", 0), kHeapfileErrorBadValue, "length is 0"},
        {with("/regions/1/dirtyBytes", 16385), kHeapfileErrorInconsistent,
         "\"dirtyBytes\" 16385 is larger than the region (16384 bytes)"},
        {with("/regions/1/address", "0x401000"), kHeapfileErrorInconsistent,
         "region 1 (0x401000) starts before the end of region 0 (0x402000)"},
        {with("/regions/0/purgeableState", 7), kHeapfileErrorBadValue, "\"purgeableState\" is 7"},
        // A part repeats its mapping's whole range, nothing less.
        {with("/regions/1", json{{"address", "0x400000"}, {"length", "0x1000"}, {"type", "x"}, {"protection", 0},
                                 {"maxProtection", 0}, {"userTag", 0}, {"residentBytes", 0},
                                 {"sharedNowPrivateBytes", 0}, {"swappedBytes", 0}, {"dirtyBytes", 0},
                                 {"referenceCount", 0}, {"externalPager", false}, {"shareMode", 3},
                                 {"submap", false}, {"objectId", 0}, {"purgeableState", 3}}),
         kHeapfileErrorInconsistent, "region 1 (0x400000) starts before the end of region 0 (0x402000)"},
        {with("/regions/0/offset", -1), kHeapfileErrorBadValue, "\"offset\" is negative"},
    };
    for (const auto &[text, code, mentions] : cases) {
        SCOPED_TRACE(mentions);
        HeapfileError error;
        EXPECT_EQ(VSHeapfileReader::openFromData(text, &error), nullptr);
        EXPECT_EQ(error.domain, kHeapfileErrorDomain);
        EXPECT_EQ(error.code, code);
        EXPECT_NE(error.description.find(mentions), std::string::npos) << error.description;
        EXPECT_EQ(VSHeapfileReader::openFromData(text, nullptr), nullptr);  // the same, quietly
    }
}

TEST(HeapfileFormatTest, ReadersSkipUnknownKeysAndRegisterRunTimeTagsAgainByName) {
    json document = validDocument();
    document["host"] = {{"kernel", "6.18"}};
    document["regions"][1]["userTag"] = 0x7FFFFFF0;  // a number from another run
    document["regions"][1]["userTagName"] = "heapfile test arena";
    document["regions"][0]["userTag"] = 5;  // the fixed table's numbers stay whatever the name
    document["regions"][0]["userTagName"] = "other";
    auto reader = VSHeapfileReader::openFromData(document.dump(), nullptr);
    ASSERT_NE(reader, nullptr);
    EXPECT_EQ(VSMemoryRegion::categoryNameForTag(reader->snapshot().regions.at(1).userTag), "heapfile test arena");
    EXPECT_EQ(reader->snapshot().regions.at(0).userTag, 5u);
}

TEST(HeapfileFormatTest, WrittenTextReadsBackUnchanged) {
    VSHeapfileRegion low = region({0x1000, 0x4000, "__DATA_CONST", "/lib/with space/libx.so", true, 0, 0x4000, 0x2000,
                                   0x1000, 0xFFFFFFFFFFFFull, 0});
    low.sharedNowPrivateBytes = 0x1000;
    low.referenceCount = 65535;
    low.submap = 1;
    VSHeapfileRegion top = region({0xffffffffff600000ull, 0x1000, "vsyscall", {}, false, 0x10005});  // above 2^53
    top.userTagName = "pool";
    VSHeapfileSnapshot snapshot = vs::testing::snapshotOf({low, top}, "ARM64 process, no shared region", 16384);
    snapshot.name = "name with \"quotes\" and ünïcode";
    snapshot.is64bit = false;
    snapshot.physVestage = 123456789012ull;
    snapshot.physVestagePeak = 223456789012ull;
    snapshot.breakDownPhysVestage = true;
    // The parts of one mapping: the same range, each in its object at its offset.
    VSHeapfileRegion part = low;
    part.objectId = 77;
    part.offset = 0x7f0000001000ull;
    snapshot.regions.insert(snapshot.regions.begin() + 1, part);
    vs::HeapfileError error;
    EXPECT_EQ(vs::parseHeapfile(vs::heapfileText(snapshot), &error), snapshot) << error.description;
    // A file from before offsets and parts reads as it stands.
    json old = json::parse(vs::heapfileText(snapshot));
    old["version"] = 1;
    old["regions"].erase(1);
    old["regions"][0].erase("offset");
    snapshot.regions.erase(snapshot.regions.begin() + 1);
    EXPECT_EQ(vs::parseHeapfile(old.dump(), &error), snapshot) << error.description;
    snapshot.regions.clear();
    EXPECT_EQ(vs::parseHeapfile(vs::heapfileText(snapshot), &error), snapshot) << error.description;
}

}  // namespace
