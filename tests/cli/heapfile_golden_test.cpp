// Whole runs of the program on the checked-in heapfiles in
// tests/data/heapfiles, compared with the reports stored beside them.
//
// After a deliberate change of the report, VESTAGE_REGENERATE_GOLDEN=1
// rewrites the stored reports; read the differences before committing.

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>
#include <vector>

#include "targets/heapfile_process.h"
#include "tests/support/run_program.h"

namespace {

const std::string kFixtures = VESTAGE_TEST_DATA_DIR "/heapfiles/";

struct GoldenCase {
    const char *report;  // stored as tests/data/heapfiles/REPORT.txt
    std::vector<std::string> args;
};

TEST(HeapfileGolden, ReportsOfTheCheckedInHeapfiles) {
    const std::vector<GoldenCase> cases = {
        {"linux-worker", {"-f", "bytes", "--swapped", "linux-worker.heap"}},
        {"linux-workers-sharing", {"linux-worker.heap", "linux-worker-peer.heap"}},
        {"arm64-shared-cache", {"-v", "-f", "bytes", "--swapped", "arm64-shared-cache.heap"}},
        {"armv7k-breakdown", {"-v", "-f", "bytes", "armv7k-breakdown.heap"}},
    };
    const bool regenerate = std::getenv("VESTAGE_REGENERATE_GOLDEN") != nullptr;
    vs::test::RunSettings inFixtures;
    inFixtures.workingDirectory = kFixtures;
    for (const GoldenCase &c : cases) {
        SCOPED_TRACE(c.report);
        const vs::test::RunResult run = vs::test::runProgram(c.args, inFixtures);
        EXPECT_EQ(run.status, 0);
        EXPECT_EQ(run.err, "");
        const std::string storedPath = kFixtures + c.report + ".txt";
        if (regenerate) {
            std::FILE *file = std::fopen(storedPath.c_str(), "wb");
            ASSERT_NE(file, nullptr) << storedPath;
            std::fwrite(run.out.data(), 1, run.out.size(), file);
            std::fclose(file);
            continue;
        }
        const std::optional<std::string> stored = vs::readWholeFile(storedPath, nullptr);
        ASSERT_TRUE(stored.has_value()) << storedPath;
        EXPECT_EQ(run.out, *stored);
    }
}

}  // namespace
