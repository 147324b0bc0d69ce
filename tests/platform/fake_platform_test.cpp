// The logic tests of the targets stand on the test double, so a process
// that goes away mid-walk must answer there as it does on the real layer
// (linux_process_test.cpp): the walk ends as a dead port, the page query
// says invalid argument, and the process is gone or a zombie.

#include "targets/platform/testing/fake_platform.h"

#include <gtest/gtest.h>

namespace {

TEST(FakePlatform, ProcessThatGoesAwayAnswersLikeTheRealLayer) {
    for (const bool zombie : {false, true}) {
        SCOPED_TRACE(zombie ? "zombie" : "exited");
        VSFakePlatform fake;
        auto p = fake.process(42, "leaver");
        p.region(0x1000, 0x1000);
        p.region(0x3000, 0x1000);
        zombie ? p.becomesZombieAt(VSFakeQuery::RegionRecurse, 2) : p.exitsAt(VSFakeQuery::RegionRecurse, 2);
        const VSTaskHandle task = VSFakePlatform::handleFor(42);
        uint64_t address = 0, size = 0;
        uint32_t depth = vs::kUnlimitedDepth, count = vs::kRegionInfoCount;
        VSRegionInfo info;
        EXPECT_EQ(fake.region_recurse(task, address, size, depth, info, count), vs::kReturnSuccess);
        address += size;
        EXPECT_EQ(fake.region_recurse(task, address, size, depth, info, count), vs::kReturnDeadPort);
        std::vector<int32_t> words(1);
        EXPECT_EQ(fake.page_range_query(task, 0x1000, 0x1000, words, size), vs::kReturnInvalidArgument);
        VSShortInfo shortInfo;
        int32_t error = 0;
        EXPECT_EQ(fake.pid_short_info(42, shortInfo, error), zombie ? static_cast<int32_t>(sizeof shortInfo) : 0);
        EXPECT_EQ(zombie ? shortInfo.runStatus : static_cast<uint32_t>(error),
                  zombie ? vs::kRunStatusZombie : static_cast<uint32_t>(vs::kErrorNoSuchProcess));
    }
}

} // namespace
