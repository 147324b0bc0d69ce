// The heapfile document: every way a file can be unusable gives an error
// naming the problem; what the writer produces reads back unchanged; the
// description picks the platform.

#include <gtest/gtest.h>

#include <functional>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "model/memory_region.h"
#include "targets/heapfile_format.h"
#include "targets/platform/platform.h"

namespace {

using nlohmann::json;

json validDocument() {
    return json::parse(R"({
      "format": "vestage-heapfile", "version": 1, "pid": 4242, "name": "worker",
      "description": "X86-64 process worker [4242], no shared region",
      "pointerWidth": 64, "pageSize": 4096, "physVestage": 1048576, "physVestagePeak": 2097152,
      "breakDownPhysVestage": false,
      "regions": [
        {"address": "0x400000", "length": "0x2000", "type": "__TEXT", "path": "/usr/bin/worker",
         "protection": 5, "maxProtection": 7, "userTag": 0, "residentBytes": 8192,
         "sharedNowPrivateBytes": 0, "swappedBytes": 0, "dirtyBytes": 0, "referenceCount": 2,
         "externalPager": true, "shareMode": 1, "submap": false, "objectId": 17, "purgeableState": 3},
        {"address": "0x600000", "length": "0x4000", "type": "sbrk", "path": null,
         "protection": 3, "maxProtection": 7, "userTag": 5, "residentBytes": 12288,
         "sharedNowPrivateBytes": 0, "swappedBytes": 4096, "dirtyBytes": 12288, "referenceCount": 1,
         "externalPager": false, "shareMode": 2, "submap": false, "objectId": 18, "purgeableState": 3}
      ]})");
}

struct BadCase {
    const char *what;
    std::function<std::string()> text;
    int64_t code;
    std::string mentions;  // part of the description
};

std::string edited(const std::function<void(json &)> &edit) {
    json document = validDocument();
    edit(document);
    return document.dump();
}

TEST(HeapfileFormatTest, BadFilesAreRefusedWithTheirProblemNamed) {
    const std::string whole = validDocument().dump(2);
    const std::vector<BadCase> cases = {
        {"empty file", [] { return std::string(); }, vs::kHeapfileErrorEmpty, "empty"},
        {"truncated", [&] { return whole.substr(0, whole.size() / 2); }, vs::kHeapfileErrorSyntax, "truncated"},
        {"not JSON", [] { return std::string("MALLOC_TINY 0x1000 rw-"); }, vs::kHeapfileErrorSyntax,
         "syntax error at byte"},
        {"binary bytes", [] { return std::string("\x7f" "ELF\x02\x01\x01\0\0\0", 10); }, vs::kHeapfileErrorSyntax,
         "not a JSON document"},
        {"JSON, but a list", [] { return std::string("[1, 2]"); }, vs::kHeapfileErrorNotHeapfile, "not a JSON object"},
        {"deeply nested", [] { return std::string(10000, '[') + std::string(10000, ']'); },
         vs::kHeapfileErrorNotHeapfile, "nested"},
        {"no format key", [] { return edited([](json &d) { d.erase("format"); }); }, vs::kHeapfileErrorNotHeapfile,
         "no \"format\""},
        {"another format", [] { return edited([](json &d) { d["format"] = "other-snapshot"; }); },
         vs::kHeapfileErrorNotHeapfile, "\"other-snapshot\""},
        {"a later version", [] { return edited([](json &d) { d["version"] = 2; }); }, vs::kHeapfileErrorVersion,
         "version 2 is not supported"},
        {"no version", [] { return edited([](json &d) { d.erase("version"); }); }, vs::kHeapfileErrorMissingKey,
         "\"version\""},
        {"no pid", [] { return edited([](json &d) { d.erase("pid"); }); }, vs::kHeapfileErrorMissingKey,
         "missing key \"pid\""},
        {"negative pid", [] { return edited([](json &d) { d["pid"] = -3; }); }, vs::kHeapfileErrorBadValue,
         "\"pid\" is negative"},
        {"pid beyond 32 bits", [] { return edited([](json &d) { d["pid"] = 4294967296ull; }); },
         vs::kHeapfileErrorBadValue, "above its limit"},
        {"page size not a power of two", [] { return edited([](json &d) { d["pageSize"] = 3000; }); },
         vs::kHeapfileErrorBadValue, "\"pageSize\" is 3000, not a power of two"},
        {"page size with a fraction", [] { return edited([](json &d) { d["pageSize"] = 4096.5; }); },
         vs::kHeapfileErrorBadValue, "\"pageSize\" is not a non-negative integer"},
        {"pointer width 48", [] { return edited([](json &d) { d["pointerWidth"] = 48; }); },
         vs::kHeapfileErrorBadValue, "expected 32 or 64"},
        {"breakdown mode as text", [] { return edited([](json &d) { d["breakDownPhysVestage"] = "yes"; }); },
         vs::kHeapfileErrorBadValue, "not true or false"},
        {"no regions", [] { return edited([](json &d) { d.erase("regions"); }); }, vs::kHeapfileErrorMissingKey,
         "\"regions\""},
        {"a region that is no object", [] { return edited([](json &d) { d["regions"][1] = 7; }); },
         vs::kHeapfileErrorBadValue, "region 1: not a JSON object"},
        {"a region without an address", [] { return edited([](json &d) { d["regions"][0].erase("address"); }); },
         vs::kHeapfileErrorMissingKey, "region 0: missing key \"address\""},
        {"an address that is no number", [] { return edited([](json &d) { d["regions"][0]["address"] = "0xZZ"; }); },
         vs::kHeapfileErrorBadValue, "\"address\" is not a number"},
        {"a region ending below its start",
         [] {
             return edited([](json &d) {
                 d["regions"].erase(1);
                 d["regions"][0]["address"] = "0xfffffffffffff000";
                 d["regions"][0]["length"] = "0x2000";
                 d["regions"][0]["residentBytes"] = 0;
             });
         },
         vs::kHeapfileErrorBadValue, "ends below its start"},
        {"a region of length 0", [] { return edited([](json &d) { d["regions"][1]["length"] = 0; }); },
         vs::kHeapfileErrorBadValue, "length is 0"},
        {"dirty bytes larger than the region",
         [] { return edited([](json &d) { d["regions"][1]["dirtyBytes"] = 16385; }); },
         vs::kHeapfileErrorInconsistent, "\"dirtyBytes\" 16385 is larger than the region (16384 bytes)"},
        {"resident bytes larger than the region",
         [] { return edited([](json &d) { d["regions"][0]["residentBytes"] = 1 << 20; }); },
         vs::kHeapfileErrorInconsistent, "\"residentBytes\""},
        {"regions out of order",
         [] { return edited([](json &d) { std::swap(d["regions"][0], d["regions"][1]); }); },
         vs::kHeapfileErrorInconsistent, "region 1 (0x400000) starts before the end of region 0 (0x604000)"},
        {"overlapping regions", [] { return edited([](json &d) { d["regions"][1]["address"] = "0x401000"; }); },
         vs::kHeapfileErrorInconsistent, "starts before the end of region 0"},
        {"a reference count beyond 16 bits",
         [] { return edited([](json &d) { d["regions"][0]["referenceCount"] = 70000; }); },
         vs::kHeapfileErrorBadValue, "\"referenceCount\" is 70000"},
        {"an unknown purgeable state",
         [] { return edited([](json &d) { d["regions"][0]["purgeableState"] = 7; }); }, vs::kHeapfileErrorBadValue,
         "\"purgeableState\" is 7"},
        {"a negative byte count", [] { return edited([](json &d) { d["regions"][1]["dirtyBytes"] = -4096; }); },
         vs::kHeapfileErrorBadValue, "\"dirtyBytes\" is negative"},
        {"no type", [] { return edited([](json &d) { d["regions"][0].erase("type"); }); },
         vs::kHeapfileErrorMissingKey, "\"type\""},
    };
    for (const BadCase &c : cases) {
        SCOPED_TRACE(c.what);
        vs::HeapfileError error;
        const std::string text = c.text();
        EXPECT_EQ(VSHeapfileReader::openFromData(text, &error), nullptr);
        EXPECT_EQ(error.domain, vs::kHeapfileErrorDomain);
        EXPECT_EQ(error.code, c.code);
        EXPECT_NE(error.description.find(c.mentions), std::string::npos) << error.description;
        // Without an error out the answer is the same, quietly.
        EXPECT_EQ(VSHeapfileReader::openFromData(text, nullptr), nullptr);
    }
}

TEST(HeapfileFormatTest, ReadersSkipKeysTheyDoNotKnowAndTakeNumbersInEitherSpelling) {
    json document = validDocument();
    document["capturedAt"] = "2026-11-23T01:00:00Z";
    document["host"] = {{"kernel", "6.18"}};
    document["regions"][0]["inheritance"] = 1;
    document["regions"][1]["address"] = 6291456;  // plain number instead of hex text
    document["regions"][1]["length"] = "16384";   // decimal text
    document["regions"][1].erase("path");         // absent path: none
    document["regions"][1]["externalPager"] = 0;  // 0/1 for a flag
    document["regions"][1]["submap"] = 1;

    vs::HeapfileError error;
    auto reader = VSHeapfileReader::openFromData(document.dump(), &error);
    ASSERT_NE(reader, nullptr) << error.description;
    EXPECT_EQ(reader->pid(), 4242);
    EXPECT_EQ(reader->processName(), "worker");
    EXPECT_TRUE(reader->is64bit());
    EXPECT_EQ(reader->pageSize(), 4096u);
    EXPECT_EQ(reader->physVestage(), 1048576u);
    EXPECT_EQ(reader->physVestagePeak(), 2097152u);
    EXPECT_FALSE(reader->breakDownPhysVestage());
    const VSHeapfileRegion &heap = reader->snapshot().regions.at(1);
    EXPECT_EQ(heap.address, 0x600000u);
    EXPECT_EQ(heap.length, 0x4000u);
    EXPECT_EQ(heap.path, std::nullopt);
    EXPECT_EQ(heap.externalPager, 0);
    EXPECT_EQ(heap.submap, 1);
}

TEST(HeapfileFormatTest, WrittenTextReadsBackUnchanged) {
    VSHeapfileSnapshot snapshot;
    snapshot.pid = 77;
    snapshot.name = "name with \"quotes\" and ünïcode";
    snapshot.description = "ARM64 process, no shared region";
    snapshot.is64bit = false;
    snapshot.pageSize = 16384;
    snapshot.physVestage = 123456789012ull;
    snapshot.physVestagePeak = 223456789012ull;
    snapshot.breakDownPhysVestage = true;
    VSHeapfileRegion low;
    low.address = 0x1000;
    low.length = 0x4000;
    low.type = "__DATA_CONST";
    low.path = "/lib/with space/libx.so";
    low.protection = 1;
    low.maxProtection = 7;
    low.residentBytes = 0x4000;
    low.dirtyBytes = 0x2000;
    low.sharedNowPrivateBytes = 0x1000;
    low.swappedBytes = 0x1000;
    low.referenceCount = 65535;
    low.externalPager = 1;
    low.shareMode = 4;
    low.submap = 1;
    low.objectId = 0xFFFFFFFFFFFFull;
    low.purgeableState = 0;
    VSHeapfileRegion top;  // the vsyscall page: above 2^53, kept exact
    top.address = 0xffffffffff600000ull;
    top.length = 0x1000;
    top.type = "vsyscall";
    top.userTag = 0x10005;
    top.userTagName = "pool";
    top.protection = 4;
    snapshot.regions = {low, top};

    vs::HeapfileError error;
    const std::optional<VSHeapfileSnapshot> back = vs::parseHeapfile(vs::heapfileText(snapshot), &error);
    ASSERT_TRUE(back.has_value()) << error.description;
    EXPECT_EQ(*back, snapshot);

    snapshot.regions.clear();
    const std::optional<VSHeapfileSnapshot> empty = vs::parseHeapfile(vs::heapfileText(snapshot), &error);
    ASSERT_TRUE(empty.has_value()) << error.description;
    EXPECT_EQ(*empty, snapshot);
}

TEST(HeapfileFormatTest, RunTimeTagsAreRegisteredAgainByName) {
    json document = validDocument();
    document["regions"][1]["userTag"] = 0x7FFFFFF0;  // a number from another run
    document["regions"][1]["userTagName"] = "heapfile test arena";
    auto reader = VSHeapfileReader::openFromData(document.dump(), nullptr);
    ASSERT_NE(reader, nullptr);
    const uint32_t tag = reader->snapshot().regions.at(1).userTag;
    EXPECT_EQ(tag, vs::registerDynamicTagName("heapfile test arena"));
    EXPECT_EQ(VSMemoryRegion::categoryNameForTag(tag), "heapfile test arena");
    // A tag of the fixed table keeps its number whatever name came along.
    document["regions"][1]["userTag"] = 5;
    reader = VSHeapfileReader::openFromData(document.dump(), nullptr);
    ASSERT_NE(reader, nullptr);
    EXPECT_EQ(reader->snapshot().regions.at(1).userTag, 5u);
}

TEST(HeapfileFormatTest, DescriptionSelectsThePlatform) {
    const std::vector<std::pair<std::string, uint64_t>> cases = {
        {"iPhone ARM64-32 watch", VSPlatformARM64_32},
        {"process ARM64", VSPlatformARM64},        // at the very end
        {"process ARM64-3", VSPlatformARM64},      // fewer than three characters follow
        {"process ARM64-32", VSPlatformARM64_32},  // exactly three follow
        {"ARM64e", VSPlatformARM64},
        {"X86-64 (translated)", VSPlatformX86_64},
        {"X86 with ARM helpers", VSPlatformX86},  // X86 is tested first
        {"ARMv7", VSPlatformARM},
        {"arm64", VSPlatformUnknown},  // case matters
        {"x86_64", VSPlatformUnknown},
        {"", VSPlatformUnknown},
        {"X86-64 process, no shared region", VSPlatformNone},
        {"no shared region", VSPlatformNone},
        {"No Shared Region ARM64", VSPlatformARM64},
    };
    for (const auto &[description, code] : cases) {
        SCOPED_TRACE(description);
        EXPECT_EQ(vs::platformCodeForHeapfileDescription(description), code);
    }
}

TEST(HeapfileFormatTest, EnumerationStopsWhenAsked) {
    auto reader = VSHeapfileReader::openFromData(validDocument().dump(), nullptr);
    ASSERT_NE(reader, nullptr);
    std::vector<uint64_t> seen;
    reader->enumerateRegions([&](const VSHeapfileRegion &region, bool &stop) {
        seen.push_back(region.address);
        stop = true;
    });
    EXPECT_EQ(seen, std::vector<uint64_t>{0x400000});
}

}  // namespace
