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
        {"linux-workers-openmetrics", {"--openmetrics", "-", "linux-worker.heap", "linux-worker-peer.heap"}},
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

// The OpenMetrics text as a real scraper's parser reads it: every family a
// gauge in bytes, every sample parsed, the document closed by "# EOF". The
// kernel's categories bring names of every shape.
TEST(OpenMetricsRun, ARealParserReadsEveryFamily) {
    const std::string parser = "/usr/bin/python3"; // the distribution's, which has the parser package
    if (access(parser.c_str(), X_OK) != 0) GTEST_SKIP() << "no python3 for the parser";
    const std::string fixtures = VESTAGE_TEST_DATA_DIR "/heapfiles/";
    std::vector<std::vector<std::string>> runs = {
        {"--openmetrics", "-", fixtures + "linux-worker.heap", fixtures + "linux-worker-peer.heap"}};
    if (geteuid() == 0) runs.push_back({"--openmetrics", "-", "-p", "0", "-p", std::to_string(getpid())});
    for (const auto &args : runs) {
        SCOPED_TRACE(args.back());
        const vs::test::RunResult run = vs::test::runProgram(args);
        ASSERT_EQ(run.status, 0) << run.err;
        vs::test::ScratchDir dir;
        const std::string input = dir.path + "/metrics.txt";
        std::ofstream(input) << run.out;
        const std::string script =
            "import sys\n"
            "from prometheus_client.openmetrics.parser import text_string_to_metric_families as parse\n"
            "for f in parse(open(sys.argv[1]).read()):\n"
            "    print(f.name, f.type, f.unit, len(f.samples))\n";
        const std::string command = parser + " -c '" + script + "' " + input + " 2>&1";
        std::string parsed;
        if (FILE *pipe = popen(command.c_str(), "r")) {
            char buffer[4096];
            for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) parsed.append(buffer, n);
            const int status = pclose(pipe);
            if (parsed.find("No module named") != std::string::npos) GTEST_SKIP() << parsed;
            EXPECT_EQ(status, 0) << parsed << run.out;
        }
        EXPECT_NE(parsed.find("vestage_process_bytes gauge bytes 2"), std::string::npos) << parsed;
        EXPECT_NE(parsed.find("vestage_all_targets_bytes gauge bytes 6"), std::string::npos) << parsed;
        if (args.back() != fixtures + "linux-worker-peer.heap") {
            EXPECT_NE(parsed.find("vestage_kernel_bytes gauge bytes"), std::string::npos) << parsed;
        }
        // The names, types and help lines as the monitoring system lints them.
        if (access("/usr/bin/promtool", X_OK) == 0) {
            const std::string lint = "/usr/bin/promtool check metrics < " + input + " 2>&1";
            std::string said;
            if (FILE *pipe = popen(lint.c_str(), "r")) {
                char buffer[4096];
                for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) said.append(buffer, n);
                EXPECT_EQ(pclose(pipe), 0) << said;
            }
            EXPECT_EQ(said, "") << said;
        }
    }
}

}  // namespace
