// Whole runs of the program against live children whose memory the test
// arranged: what a user sees for private and shared memory, and how the run
// ends for targets that cannot be found or opened, or for an interrupt.

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <fstream>
#include <nlohmann/json.hpp>
#include <regex>
#include <string>
#include <vector>

#include "tests/support/run_program.h"

namespace {

using vs::test::MemChild;
using vs::test::runProgram;
using vs::test::RunSettings;

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// The lines of one table: from the line after `heading` to the TOTAL row.
std::vector<std::string> tableAfter(const std::string &report, const std::string &heading) {
    std::vector<std::string> rows;
    size_t at = report.find(heading);
    if (at == std::string::npos) return rows;
    at = report.find('\n', at) + 1;
    while (at < report.size()) {
        size_t end = report.find('\n', at);
        std::string line = report.substr(at, end - at);
        rows.push_back(line);
        if (line.find("    TOTAL") != std::string::npos || end == std::string::npos) break;
        at = end + 1;
    }
    return rows;
}

// Dirty bytes of a category row in the bytes format, or 0 when absent.
uint64_t dirtyOf(const std::vector<std::string> &rows, const std::string &category) {
    for (const std::string &row : rows) {
        if (row.size() > category.size() && row.compare(row.size() - category.size(), category.size(), category) == 0) {
            return std::stoull(row);
        }
    }
    return 0;
}

std::string header(const std::string &name, pid_t pid) { return name + " [" + std::to_string(pid) + "]: 64-bit"; }

TEST(LiveRun, PrivateAndSharedMemoryOfAParentAndItsChild) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const uint64_t bigPages = (64u << 20) / kPage;
    MemChild parent({"anon:big:" + std::to_string(bigPages) + ":" + std::to_string(bigPages), "shared:common:64",
                     "fork:kid"});
    ASSERT_TRUE(parent.ready());
    const pid_t kid = std::stoi(parent.fact("kid", "pid"));

    auto run = runProgram({"-f", "bytes", "-p", std::to_string(parent.pid()), "--pid", std::to_string(kid)});
    ASSERT_EQ(run.status, 0) << run.err;

    // Each process section starts with its header; the private table follows
    // the closing rule directly, shared tables carry their "Shared with" line.
    const std::string parentSection = run.out.substr(run.out.find(header("vs_memchild", parent.pid())));
    const std::string kidSection = run.out.substr(run.out.find(header("vs_memchild", kid)));
    const uint64_t parentPrivate = dirtyOf(tableAfter(parentSection, "  Dirty"), "untagged (\"VM_ALLOCATE\")");
    EXPECT_GE(parentPrivate, 64u << 20) << run.out;

    // The shared region is one object in a table shared by both, counted once.
    const std::string kidName = "vs_memchild [" + std::to_string(kid) + "]";
    const std::string parentName = "vs_memchild [" + std::to_string(parent.pid()) + "]";
    EXPECT_NE(parentSection.find("Shared with " + kidName + ":"), std::string::npos) << run.out;
    EXPECT_NE(kidSection.find("Shared with " + parentName + ":"), std::string::npos) << run.out;
    const auto sharedRows = tableAfter(parentSection, "Shared with " + kidName + ":");
    EXPECT_GE(dirtyOf(sharedRows, "TOTAL"), 64 * kPage) << run.out;

    // Largest vestage first: the parent holds the 64 MiB it wrote before the fork.
    EXPECT_LT(run.out.find(header("vs_memchild", parent.pid())), run.out.find(header("vs_memchild", kid)));
}

struct FatalCase {
    const char *name;
    std::vector<std::string> args;
    std::string err;
    int status;
};

TEST(LiveRun, TargetsThatCannotBeAnalysed) {
    const std::string self = std::to_string(getpid());
    const std::vector<FatalCase> cases = {
        {"nothing matches a name", {"-p", "no-such-process-name"},
         "Unable to find pid for process matching 'no-such-process-name'\n"
         "Unable to find any processes matching the supplied process names or pids (try as root?)\n",
         1},
        {"a pid nobody has", {"--pid", "2147483000"},
         "Unable to analyze process with pid 2147483000 (try as root?)\n"
         "Unable to find any processes matching the supplied process names or pids (try as root?)\n",
         1},
        {"the only target excluded", {"--pid", self, "-x", self},
         "Unable to find any processes matching the supplied process names or pids (try as root?)\n", 1},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.name);
        auto run = runProgram(c.args);
        EXPECT_EQ(run.status, c.status);
        EXPECT_EQ(run.err, c.err);
        EXPECT_EQ(run.out, "");
    }
}

TEST(LiveRun, InterruptDuringGatheringStillReports) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    // With SIGINT pending from the start, the program meets it as soon as it
    // listens for it: gathering stops early and the report says so.
    RunSettings settings;
    settings.blockInterrupt = true;
    settings.signalAfterStart = SIGINT;
    auto run = runProgram({"-a"}, settings);
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_NE(run.err.find("Exiting early due to SIGINT\n"), std::string::npos) << run.err;
    EXPECT_NE(run.out.find("\tVestage exited early due to SIGINT and did not finish gathering all data\n"),
              std::string::npos)
        << run.out;
    EXPECT_NE(run.out.find("TOTAL"), std::string::npos);
}

TEST(LiveRun, JsonDocumentAgreesWithTheTextReport) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    MemChild child({"anon:held:256:256"});
    ASSERT_TRUE(child.ready());
    char dir[] = "/tmp/vestage-json-XXXXXX";
    ASSERT_NE(mkdtemp(dir), nullptr);
    const std::string path = std::string(dir) + "/report.json";

    auto run = runProgram({"-a", "-f", "bytes", "--json", path});
    ASSERT_EQ(run.status, 0) << run.err;
    std::ifstream in(path);
    const nlohmann::json document = nlohmann::json::parse(in, nullptr, false);
    std::remove(path.c_str());
    rmdir(dir);
    ASSERT_FALSE(document.is_discarded());

    // Processes in report order, each with the vestage its section shows
    // (on the name line, or after the warnings when there are some).
    std::vector<std::pair<int64_t, int64_t>> textOrder;
    const std::regex headerLine(R"(^.* \[(-?\d+)\]: (?:32|64)-bit)");
    const std::regex vestageLine(R"(\tVestage: (\d+) B)");
    std::istringstream lines(run.out);
    for (std::string line; std::getline(lines, line);) {
        std::smatch match;
        if (std::regex_search(line, match, headerLine)) {
            textOrder.emplace_back(std::stoll(match[1]), 0);
        }
        if (!textOrder.empty() && std::regex_search(line, match, vestageLine)) {
            textOrder.back().second = std::stoll(match[1]);
        }
    }
    std::vector<std::pair<int64_t, int64_t>> jsonOrder;
    for (const auto &process : document.at("processes")) {
        jsonOrder.emplace_back(process.at("pid").get<int64_t>(), process.at("vestage").get<int64_t>());
    }
    EXPECT_EQ(jsonOrder, textOrder);
    ASSERT_FALSE(jsonOrder.empty());

    const auto &total = document.at("summary").at("total");
    EXPECT_EQ(document.at("total vestage").get<uint64_t>(),
              total.at("dirty").get<uint64_t>());  // dirty already includes swapped
    // The summary's TOTAL row is the last one of the report.
    const size_t lastTotal = run.out.rfind("    TOTAL\n");
    ASSERT_NE(lastTotal, std::string::npos);
    const size_t rowStart = run.out.rfind('\n', lastTotal) + 1;
    EXPECT_EQ(std::stoull(run.out.substr(rowStart)), total.at("dirty").get<uint64_t>());
}

}  // namespace
