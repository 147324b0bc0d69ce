// Whole reports of the checked-in heapfiles in tests/data/heapfiles,
// compared with the reports stored beside them. The heapfiles are loaded
// the way the run loads bare file arguments and the report is printed the
// way the run prints it, so these are the texts `vestage [-v] -f FORMAT
// FILE...` shows for them.
//
// After a deliberate change of the report, VESTAGE_REGENERATE_GOLDEN=1
// rewrites the stored reports; read the differences before committing.

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "analysis/vestage.h"
#include "cli/heapfile_arguments.h"
#include "output/text_formatter.h"
#include "targets/heapfile_process.h"
#include "tests/targets/heapfile_test_support.h"
#include "tests/targets/target_test_support.h"

namespace {

const std::string kFixtures = VESTAGE_TEST_DATA_DIR "/heapfiles/";

struct GoldenCase {
    const char *report;  // stored as tests/data/heapfiles/REPORT.txt
    std::vector<std::string> heapfiles;
    bool verbose;
    int64_t format;
    int64_t options;
};

class HeapfileGoldenTest : public vs::testing::TargetTest {
protected:
    std::string reportOf(const GoldenCase &c) {
        VSTargetMap targetMap;
        VSPidTable pidTable;
        vs::BreakdownModeState mode;
        vs::testing::CapturedStream errors;
        for (const std::string &file : c.heapfiles) {
            EXPECT_EQ(vs::loadHeapfileArgument(kFixtures + file, mode, targetMap, pidTable, errors.stream()),
                      std::nullopt);
        }
        EXPECT_EQ(errors.text(), "");
        EXPECT_TRUE(pidTable.empty());
        if (mode.breakDown) {
            VSVestage::setBreakDownPhysVestage(true);
        }
        std::vector<std::unique_ptr<VSProcess>> targets;
        for (auto &entry : targetMap) {
            targets.push_back(std::move(entry.second));
        }
        VSVestage vestage(std::move(targets));
        vestage.gatherData();
        vs::testing::CapturedStream output;
        auto text = std::make_unique<VSOutputFormatterText>(c.format, c.options);
        text->setOutput(output.stream());
        vestage.addOutputFormatter(std::move(text));
        vestage.printOutputVerbose(c.verbose, false);
        return output.text();
    }
};

TEST_F(HeapfileGoldenTest, ReportsOfTheCheckedInHeapfiles) {
    // The same reports as `vestage ARGS` in tests/data/heapfiles prints them:
    //   linux-worker           -f bytes --swapped linux-worker.heap
    //   linux-workers-sharing  linux-worker.heap linux-worker-peer.heap
    //   arm64-shared-cache     -v -f bytes --swapped arm64-shared-cache.heap
    //   armv7k-breakdown       -v -f bytes armv7k-breakdown.heap
    const std::vector<GoldenCase> cases = {
        {"linux-worker", {"linux-worker.heap"}, false, VSSummaryFormatBytes, VSOutputOptionSwapped},
        {"linux-workers-sharing", {"linux-worker.heap", "linux-worker-peer.heap"}, false, VSSummaryFormatFormatted,
         0},
        {"arm64-shared-cache", {"arm64-shared-cache.heap"}, true, VSSummaryFormatBytes, VSOutputOptionSwapped},
        {"armv7k-breakdown", {"armv7k-breakdown.heap"}, true, VSSummaryFormatBytes, 0},
    };
    const bool regenerate = std::getenv("VESTAGE_REGENERATE_GOLDEN") != nullptr;
    for (const GoldenCase &c : cases) {
        SCOPED_TRACE(c.report);
        const std::string report = reportOf(c);
        const std::string storedPath = kFixtures + c.report + ".txt";
        if (regenerate) {
            std::FILE *file = std::fopen(storedPath.c_str(), "wb");
            ASSERT_NE(file, nullptr) << storedPath;
            std::fwrite(report.data(), 1, report.size(), file);
            std::fclose(file);
            continue;
        }
        const std::optional<std::string> stored = vs::readWholeFile(storedPath, nullptr);
        ASSERT_TRUE(stored.has_value()) << storedPath;
        EXPECT_EQ(report, *stored);
    }
}

}  // namespace
