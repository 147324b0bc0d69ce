// The test double is what every logic test of the targets stands on, so its
// answers must follow the real layer's rules: walk order and submap descent,
// page rounding, the codes of a process that goes away, injected failures.

#include "targets/platform/testing/fake_platform.h"

#include <gtest/gtest.h>

#include <cstring>
#include <sstream>

namespace {

constexpr uint64_t kPage = 4096;

// A process with a plain region, a mapped file, a submap holding two
// entries with a gap between them and room after them, and a last region.
void scriptAddressSpace(VSFakePlatform &fake) {
    auto p = fake.process(42, "walker");
    p.region(0x1000, 0x2000).tag(1).resident(2);
    p.region(0x8000, 0x1000).file("/usr/lib/libx.so");
    auto submap = p.region(0x100000, 0x100000).wired(3).offset(0x40);
    submap.nested(0x100000, 0x4000).tag(7);
    submap.nested(0x108000, 0x2000).tag(8);
    p.region(0x300000, 0x1000).tag(9);
}

struct Walked {
    uint64_t start;
    uint64_t size;
    uint32_t depth;
    uint32_t tag;
};

TEST(FakePlatformRegions, WalkFromZeroVisitsEveryRegionInOrderThenEnds) {
    struct Case {
        const char *name;
        uint32_t maxDepth;
        std::vector<Walked> expected;
    };
    const Case cases[] = {
        {"unlimited depth descends into the submap",
         vs::kUnlimitedDepth,
         {{0x1000, 0x2000, 0, 1}, {0x8000, 0x1000, 0, 0}, {0x100000, 0x4000, 1, 7}, {0x108000, 0x2000, 1, 8},
          {0x300000, 0x1000, 0, 9}}},
        {"depth 0 stops at the submap entry",
         0,
         {{0x1000, 0x2000, 0, 1}, {0x8000, 0x1000, 0, 0}, {0x100000, 0x100000, 0, 0}, {0x300000, 0x1000, 0, 9}}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name);
        VSFakePlatform fake;
        scriptAddressSpace(fake);
        VSTaskHandle task = 0;
        ASSERT_EQ(fake.task_handle_for_pid(42, task), vs::kReturnSuccess);

        std::vector<Walked> walked;
        uint64_t address = 0;
        VSReturnCode code = vs::kReturnSuccess;
        for (int guard = 0; guard < 20; ++guard) {
            uint64_t size = 0;
            uint32_t depth = c.maxDepth;
            uint32_t count = vs::kRegionInfoCount;
            VSRegionInfo info;
            code = fake.region_recurse(task, address, size, depth, info, count);
            if (code != vs::kReturnSuccess) {
                break;
            }
            EXPECT_EQ(count, vs::kRegionInfoCount);
            // Only an entry the depth limit kept us out of is flagged.
            EXPECT_EQ(info.isSubmap != 0, address == 0x100000 && size == 0x100000);
            walked.push_back({address, size, depth, info.userTag});
            address += size;
        }
        EXPECT_EQ(code, vs::kReturnNoMoreRegions);
        ASSERT_EQ(walked.size(), c.expected.size());
        for (size_t i = 0; i < walked.size(); ++i) {
            SCOPED_TRACE(i);
            EXPECT_EQ(walked[i].start, c.expected[i].start);
            EXPECT_EQ(walked[i].size, c.expected[i].size);
            EXPECT_EQ(walked[i].depth, c.expected[i].depth);
            EXPECT_EQ(walked[i].tag, c.expected[i].tag);
        }
    }
}

TEST(FakePlatformRegions, QueriesAtAnAddressFindTheRegionAtOrAboveIt) {
    struct Case {
        const char *name;
        bool topLevel;  // region_info instead of region_recurse
        uint64_t address;
        VSReturnCode code;
        uint64_t start;
        uint64_t size;
    };
    const Case cases[] = {
        {"recurse: inside a region gives its start", false, 0x2800, 0, 0x1000, 0x2000},
        {"recurse: in a gap gives the next region", false, 0x4000, 0, 0x8000, 0x1000},
        {"recurse: in the submap's gap gives the next nested entry", false, 0x105000, 0, 0x108000, 0x2000},
        {"recurse: past the submap's entries moves on", false, 0x10a000, 0, 0x300000, 0x1000},
        {"recurse: past the last region ends the walk", false, 0x301000, vs::kReturnNoMoreRegions, 0, 0},
        {"info: inside a nested entry gives the whole submap", true, 0x108100, 0, 0x100000, 0x100000},
        {"info: below the first region gives the first", true, 0, 0, 0x1000, 0x2000},
        {"info: past the last region ends", true, 0x400000, vs::kReturnNoMoreRegions, 0, 0},
    };
    VSFakePlatform fake;
    scriptAddressSpace(fake);
    const VSTaskHandle task = VSFakePlatform::handleFor(42);
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name);
        uint64_t address = c.address;
        uint64_t size = 0;
        VSReturnCode code;
        if (c.topLevel) {
            VSRegionBasicInfo basic;
            uint32_t count = vs::kRegionBasicInfoCount;
            uint32_t objectName = 0;
            code = fake.region_info(task, address, size, vs::kRegionBasicInfoFlavor, basic, count, objectName);
            if (code == vs::kReturnSuccess && c.start == 0x100000) {
                // The walk builds the shared-cache record from these.
                EXPECT_EQ(basic.userWiredCount, 3);
                EXPECT_EQ(basic.offset, 0x40u);
            }
        } else {
            uint32_t depth = vs::kUnlimitedDepth;
            uint32_t count = vs::kRegionInfoCount;
            VSRegionInfo info;
            code = fake.region_recurse(task, address, size, depth, info, count);
        }
        EXPECT_EQ(code, c.code);
        if (c.code == vs::kReturnSuccess) {
            EXPECT_EQ(address, c.start);
            EXPECT_EQ(size, c.size);
        }
    }
    EXPECT_EQ(fake.callCount(VSFakeQuery::RegionInfo), 3u);
    EXPECT_EQ(fake.calls(VSFakeQuery::RegionInfo)[0].address, 0x108100u);
}

TEST(FakePlatformPages, RangeIsRoundedToPagesAndLimitedByRoom) {
    struct Case {
        const char *name;
        uint64_t address;
        uint64_t length;
        size_t room;
        uint64_t count;
        std::vector<int32_t> words;
    };
    // Pages 0x10000.. carry the words 1, 2, 3, 4, 5; others read 0.
    const Case cases[] = {
        {"aligned two pages", 0x10000, 2 * kPage, 8, 2, {1, 2}},
        {"unaligned start takes the page it is in", 0x10800, kPage, 8, 2, {1, 2}},
        {"end inside a page takes that page", 0x11000, kPage + 1, 8, 2, {2, 3}},
        {"within one page", 0x12010, 0x20, 8, 1, {3}},
        {"room cuts the count", 0x10000, 5 * kPage, 3, 3, {1, 2, 3}},
        {"aligned empty range has no page", 0x10000, 0, 8, 0, {}},
        {"unscripted pages read 0", 0x14000, 2 * kPage, 8, 2, {5, 0}},
    };
    VSFakePlatform fake;
    fake.pageSize(kPage);
    fake.process(7, "pager").pages(0x10000, {1, 2, 3, 4, 5});
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name);
        std::vector<int32_t> words(c.room, -1);
        uint64_t count = 99;
        EXPECT_EQ(fake.page_range_query(VSFakePlatform::handleFor(7), c.address, c.length, words, count),
                  vs::kReturnSuccess);
        EXPECT_EQ(count, c.count);
        words.resize(count);
        EXPECT_EQ(words, c.words);
    }
    auto calls = fake.calls(VSFakeQuery::PageRangeQuery);
    ASSERT_EQ(calls.size(), std::size(cases));
    EXPECT_EQ(calls[4].length, 5 * kPage);
    EXPECT_EQ(calls[4].room, 3u);
}

// Calls one query against pid 42's task and returns its code.
VSReturnCode callQuery(VSFakePlatform &fake, VSFakeQuery query) {
    VSTaskHandle task = VSFakePlatform::handleFor(42);
    uint64_t address = 0;
    uint64_t size = 0;
    uint32_t depth = vs::kUnlimitedDepth;
    uint32_t count = vs::kRegionInfoCount;
    VSRegionInfo info;
    std::vector<int32_t> words(4);
    uint64_t wordCount = 0;
    int32_t state = 0;
    switch (query) {
        case VSFakeQuery::RegionRecurse:
            return fake.region_recurse(task, address, size, depth, info, count);
        case VSFakeQuery::PageRangeQuery:
            return fake.page_range_query(task, 0x1000, kPage, words, wordCount);
        case VSFakeQuery::PurgeableControl:
            return fake.purgeable_control(task, 0x1000, vs::kPurgeableGetState, state);
        default:
            ADD_FAILURE() << "query not covered";
            return -1;
    }
}

TEST(FakePlatformFailures, InjectedCodesHitExactlyTheScriptedCalls) {
    struct Case {
        const char *name;
        VSFakeFailure failure;
        VSFakeQuery query;
        std::vector<VSReturnCode> codes;  // of consecutive calls
    };
    const Case cases[] = {
        {"fifth walk query fails",
         {VSFakeQuery::RegionRecurse, std::nullopt, 5, 5, vs::kReturnDeadPort},
         VSFakeQuery::RegionRecurse,
         {0, 0, 0, 0, vs::kReturnDeadPort, 0}},
        {"from the second page query on",
         {VSFakeQuery::PageRangeQuery, std::nullopt, 2, UINT64_MAX, vs::kReturnInvalidArgument},
         VSFakeQuery::PageRangeQuery,
         {0, 4, 4}},
        {"a failure for another pid does not apply",
         {VSFakeQuery::RegionRecurse, 43, 1, UINT64_MAX, 5},
         VSFakeQuery::RegionRecurse,
         {0, 0}},
        {"a failure for another query does not apply",
         {VSFakeQuery::RegionInfo, std::nullopt, 1, UINT64_MAX, 5},
         VSFakeQuery::RegionRecurse,
         {0, 0}},
        {"per-pid failure counts this pid's calls",
         {VSFakeQuery::PurgeableControl, 42, 2, 2, 9},
         VSFakeQuery::PurgeableControl,
         {0, 9, 0}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name);
        VSFakePlatform fake;
        fake.process(42, "victim").region(0x1000, kPage).purgeable(VSPurgeableVolatile);
        fake.process(43, "bystander").region(0x1000, kPage);
        fake.addFailure(c.failure);
        std::vector<VSReturnCode> codes;
        for (size_t i = 0; i < c.codes.size(); ++i) {
            codes.push_back(callQuery(fake, c.query));
        }
        EXPECT_EQ(codes, c.codes);
    }
}

TEST(FakePlatformFailures, ProcessThatGoesAwayAnswersLikeTheRealLayer) {
    struct Case {
        const char *name;
        bool zombie;
        bool listed;
        int32_t shortInfoBytes;
        int32_t shortInfoError;
        uint32_t runStatus;
    };
    const Case cases[] = {
        {"exits at the third walk query", false, false, 0, vs::kErrorNoSuchProcess, 0},
        {"becomes a zombie at the third walk query", true, true, sizeof(VSShortInfo), 0, vs::kRunStatusZombie},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name);
        VSFakePlatform fake;
        auto p = fake.process(42, "leaver");
        p.region(0x1000, kPage);
        p.region(0x3000, kPage);
        p.region(0x5000, kPage);
        if (c.zombie) {
            p.becomesZombieAt(VSFakeQuery::RegionRecurse, 3);
        } else {
            p.exitsAt(VSFakeQuery::RegionRecurse, 3);
        }
        EXPECT_EQ(callQuery(fake, VSFakeQuery::RegionRecurse), vs::kReturnSuccess);
        EXPECT_EQ(callQuery(fake, VSFakeQuery::PageRangeQuery), vs::kReturnSuccess);
        EXPECT_EQ(callQuery(fake, VSFakeQuery::RegionRecurse), vs::kReturnSuccess);
        EXPECT_EQ(callQuery(fake, VSFakeQuery::RegionRecurse), vs::kReturnDeadPort);
        EXPECT_EQ(callQuery(fake, VSFakeQuery::PageRangeQuery), vs::kReturnInvalidArgument);
        EXPECT_EQ(callQuery(fake, VSFakeQuery::PurgeableControl), vs::kReturnDeadPort);

        VSShortInfo info;
        int32_t error = 0;
        EXPECT_EQ(fake.pid_short_info(42, info, error), c.shortInfoBytes);
        EXPECT_EQ(error, c.shortInfoError);
        if (c.shortInfoBytes > 0) {
            EXPECT_EQ(info.runStatus, c.runStatus);
        }
        std::vector<int32_t> pids(4);
        EXPECT_EQ(fake.list_all_pids(pids), c.listed ? 1 : 0);
        char path[16];
        EXPECT_EQ(fake.pid_region_filename(42, 0x1000, path), 0);
    }
}

TEST(FakePlatformProcesses, ListingRecordsHandlesAndCorpses) {
    VSFakePlatform fake;
    fake.kernelProcess();
    fake.process(1, "init");
    fake.process(300, "a-name-longer-than-sixteen-bytes-and-thirty-two").parent(1);
    fake.process(50, "gone").exited();
    fake.process(77, "crashed").corpse().region(0x1000, kPage).tag(3);
    fake.process(60, "guarded").refuseTaskHandle(13);

    std::vector<int32_t> none;
    EXPECT_EQ(fake.list_all_pids(none), 4);  // kernel, init, 300, guarded: in script order
    std::vector<int32_t> pids(3);
    ASSERT_EQ(fake.list_all_pids(pids), 3);
    EXPECT_EQ(pids, (std::vector<int32_t>{0, 1, 300}));

    VSBsdInfo info;
    ASSERT_EQ(fake.pid_bsd_info(0, info), 136);
    EXPECT_EQ(info.flags & vs::kBsdInfoFlagSystem, vs::kBsdInfoFlagSystem);
    ASSERT_EQ(fake.pid_bsd_info(300, info), 136);
    EXPECT_EQ(info.pid, 300u);
    EXPECT_EQ(info.ppid, 1u);
    // Both name fields are cut to their size and not terminated when full.
    EXPECT_EQ(std::string(info.commandName, 16), "a-name-longer-th");
    EXPECT_EQ(std::string(info.name, 32), "a-name-longer-than-sixteen-bytes");
    EXPECT_EQ(fake.pid_bsd_info(50, info), 0);
    EXPECT_EQ(fake.pid_bsd_info(77, info), 0);

    VSTaskHandle task = 0;
    EXPECT_EQ(fake.task_handle_for_pid(60, task), 13);
    EXPECT_EQ(fake.task_handle_for_pid(77, task), vs::kErrorNoSuchProcess);
    ASSERT_EQ(fake.task_handle_for_pid(1, task), vs::kReturnSuccess);
    EXPECT_EQ(fake.openTaskHandles(), 1u);
    EXPECT_EQ(fake.release_task_handle(task), vs::kReturnSuccess);
    EXPECT_EQ(fake.release_task_handle(task), vs::kReturnInvalidArgument);
    EXPECT_EQ(fake.openTaskHandles(), 0u);

    // A crash snapshot's memory stays readable through the port handed over.
    fake.corpsePort(77);
    std::vector<uint32_t> ports;
    ASSERT_EQ(fake.ports_lookup(ports), vs::kReturnSuccess);
    ASSERT_EQ(ports.size(), 1u);
    uint64_t address = 0, size = 0;
    uint32_t depth = vs::kUnlimitedDepth, count = vs::kRegionInfoCount;
    VSRegionInfo region;
    ASSERT_EQ(fake.region_recurse(ports[0], address, size, depth, region, count), vs::kReturnSuccess);
    EXPECT_EQ(region.userTag, 3u);
}

TEST(FakePlatformProcesses, ArgumentAreaHasCountPathPaddingArguments) {
    VSFakePlatform fake;
    fake.process(9, "short").executable("/usr/libexec/foo", {"foo", "-v"});
    fake.process(10, "noargs");

    std::vector<char> area(256);
    size_t length = 0;
    ASSERT_EQ(fake.process_argument_area(9, area, length), 0);
    const std::string expected("\x02\x00\x00\x00"
                               "/usr/libexec/foo"
                               "\x00\x00\x00\x00"
                               "foo\x00-v\x00",
                               4 + 16 + 4 + 4 + 3);
    EXPECT_EQ(std::string(area.data(), length), expected);
    EXPECT_NE(fake.process_argument_area(10, area, length), 0);
    std::vector<char> tooSmall(8);
    EXPECT_NE(fake.process_argument_area(9, tooSmall, length), 0);
}

TEST(FakePlatformQueries, PurgeableStatesAndFilePaths) {
    VSFakePlatform fake;
    auto p = fake.process(5, "mapper");
    p.region(0x1000, 0x3000).purgeable(VSPurgeableEmpty).file("/data/a-fairly-long-file-name");
    p.region(0x8000, kPage);
    p.purgeableAt(0x2000, VSPurgeableVolatile);
    auto cache = p.region(0x100000, 0x10000);
    cache.nested(0x100000, kPage).path("/inner");

    const VSTaskHandle task = VSFakePlatform::handleFor(5);
    struct Case {
        uint64_t address;
        VSReturnCode code;
        int32_t state;
    };
    const Case purgeable[] = {
        {0x1000, 0, VSPurgeableEmpty},
        {0x2000, 0, VSPurgeableVolatile},  // the per-address state wins
        {0x8000, vs::kReturnInvalidArgument, -1},
        {0x9000, vs::kReturnInvalidArgument, -1},
    };
    for (const Case &c : purgeable) {
        SCOPED_TRACE(c.address);
        int32_t state = -1;
        EXPECT_EQ(fake.purgeable_control(task, c.address, vs::kPurgeableGetState, state), c.code);
        EXPECT_EQ(state, c.state);
    }

    char buffer[vs::kRegionFilenameBufferSize];
    int32_t length = fake.pid_region_filename(5, 0x1800, buffer);
    EXPECT_EQ(std::string(buffer, length), "/data/a-fairly-long-file-name");
    char small[6];
    length = fake.pid_region_filename(5, 0x1800, small);
    EXPECT_EQ(std::string(small, length), "/data/");
    EXPECT_EQ(fake.pid_region_filename(5, 0x8000, buffer), 0);
    length = fake.pid_region_filename(5, 0x100000, buffer);
    EXPECT_EQ(std::string(buffer, length), "/inner");
}

TEST(FakePlatformKernel, ArraysMustBeReleasedWithTheirLengths) {
    VSFakePlatform fake;
    auto kernel = fake.kernel();
    kernel.zone("kalloc.64", 10, 4096, 64, true).zone("vm.pages", 1, 8192, 8192);
    kernel.site(vs::kSiteTypeTag | vs::kSiteFlagWired, 13, 4096).zone(1);
    kernel.symbol(0x1000, 0x100, "do_work").sourceLocation(0x1000, "work.c", 12);

    std::span<const VSKernelZoneName> names;
    std::span<const VSKernelZoneInfo> infos;
    std::span<const VSKernelSiteInfo> sites;
    ASSERT_EQ(fake.kernel_memory_info(names, infos, sites), vs::kReturnSuccess);
    ASSERT_EQ(names.size(), 2u);
    ASSERT_EQ(sites.size(), 1u);
    EXPECT_EQ(sites[0].flags, vs::kSiteTypeTag | vs::kSiteFlagWired | vs::kSiteFlagZoneShare);
    EXPECT_EQ(fake.outstandingKernelArrays(), 3u);

    EXPECT_EQ(fake.release_memory(infos.data(), infos.size() * 80), vs::kReturnInvalidArgument);
    EXPECT_EQ(fake.release_memory(infos.data(), infos.size() * sizeof(VSKernelZoneInfo)), vs::kReturnSuccess);
    EXPECT_EQ(fake.release_memory(names.data(), names.size() * sizeof(VSKernelZoneName)), vs::kReturnSuccess);
    EXPECT_EQ(fake.release_memory(names.data(), names.size() * sizeof(VSKernelZoneName)),
              vs::kReturnInvalidArgument);
    EXPECT_EQ(fake.outstandingKernelArrays(), 1u);

    auto symbolicator = fake.kernel_symbolicator();
    ASSERT_NE(symbolicator, nullptr);
    EXPECT_EQ(symbolicator->symbol_name_at(0x10ff), "do_work");
    EXPECT_EQ(symbolicator->symbol_name_at(0x1100), std::nullopt);
    ASSERT_TRUE(symbolicator->source_location_at(0x1000).has_value());
    EXPECT_EQ(symbolicator->source_location_at(0x1000)->line, 12u);

    // An empty kernel still hands out arrays that can be released.
    VSFakePlatform empty;
    ASSERT_EQ(empty.kernel_memory_info(names, infos, sites), vs::kReturnSuccess);
    EXPECT_TRUE(names.empty());
    EXPECT_EQ(empty.release_memory(names.data(), 0), vs::kReturnSuccess);
    EXPECT_EQ(empty.release_memory(sites.data(), 0), vs::kReturnSuccess);
    EXPECT_EQ(empty.outstandingKernelArrays(), 1u);
}

TEST(FakePlatformQueries, InstallationAndReportedErrors) {
    VSFakePlatform outer;
    auto outerInstalled = outer.install();
    {
        VSFakePlatform inner;
        std::ostringstream errors;
        inner.errorStream(&errors).errorText(vs::kReturnDeadPort, "gone");
        auto installed = inner.install();
        EXPECT_EQ(&VSPlatform::current(), &inner);
        VSPlatform::current().report_error_code("region_recurse", vs::kReturnDeadPort);
        EXPECT_EQ(errors.str(), "region_recurse: gone\n");
        ASSERT_EQ(inner.reportedErrors().size(), 1u);
    }
    EXPECT_EQ(&VSPlatform::current(), &outer);
}

}  // namespace
