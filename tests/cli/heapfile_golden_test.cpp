// Whole runs of the program on the checked-in heapfiles in
// tests/data/heapfiles, compared with the reports stored beside them.

#include <fstream>
#include <sstream>

#include "tests/support/run_program.h"

namespace {

TEST(HeapfileGolden, ReportsOfTheCheckedInHeapfiles) {
    const std::string fixtures = VESTAGE_TEST_DATA_DIR "/heapfiles/";
    const std::pair<const char *, std::vector<std::string>> cases[] = {  // stored as REPORT.txt, command line
        {"linux-worker", {"-f", "bytes", "--swapped", "linux-worker.heap"}},
        {"linux-workers-sharing", {"linux-worker.heap", "linux-worker-peer.heap"}},
        {"linux-workers-top", {"--top", "linux-worker.heap", "linux-worker-peer.heap"}},
        {"linux-workers-top-1-bytes", {"--top=1", "-f", "bytes", "linux-worker.heap", "linux-worker-peer.heap"}},
        {"arm64-shared-cache", {"-v", "-f", "bytes", "--swapped", "arm64-shared-cache.heap"}},
        {"armv7k-breakdown", {"-v", "-f", "bytes", "armv7k-breakdown.heap"}},
    };
    for (const auto &[report, args] : cases) {
        SCOPED_TRACE(report);
        const vs::test::RunResult run = vs::test::runProgram(args, {.workingDirectory = fixtures});
        EXPECT_EQ(run.status, 0);
        EXPECT_EQ(run.err, "");
        std::ostringstream stored;
        stored << std::ifstream(fixtures + report + ".txt", std::ios::binary).rdbuf();
        EXPECT_EQ(run.out, stored.str());
    }
}

}  // namespace
