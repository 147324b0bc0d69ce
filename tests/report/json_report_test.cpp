// The JSON document read back as parsed values (key order is free), and
// where the write lands; a failed one leaves everything as it was.

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <set>
#include <iterator>

#include <nlohmann/json.hpp>

#include "output/json_formatter.h"
#include "tests/report/report_support.h"

using namespace report_test;
using nlohmann::json;
namespace fs = std::filesystem;

namespace {

// A fresh directory under /tmp that an unprivileged child can traverse.
struct ScratchDir {
    ScratchDir() {
        char pattern[] = "/tmp/vestage-json-XXXXXX";
        path = mkdtemp(pattern) != nullptr ? pattern : "/nonexistent";
        fs::permissions(path, fs::perms::others_read | fs::perms::others_exec, fs::perm_options::add);
    }
    ~ScratchDir() { fs::remove_all(path); }
    fs::path path;
};

std::string readFile(const fs::path &path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

void writeFile(const fs::path &path, const std::string &text) { std::ofstream(path, std::ios::binary) << text; }

std::set<std::string> entriesOf(const fs::path &directory) {
    std::set<std::string> names;
    std::error_code ignored;
    for (const auto &entry : fs::directory_iterator(directory, ignored)) {
        names.insert(entry.path().filename().string());
    }
    return names;
}

const json kDaemonDocument = json::parse(R"({
  "total vestage": 9502720,
  "summary": {
    "MALLOC_SMALL": {"dirty": 9437184, "swapped": 1048576, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
    "stack": {"dirty": 65536, "swapped": 0, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 3},
    "total": {"dirty": 9502720, "swapped": 1048576, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 5}},
  "processes": [{"name": "daemon", "pid": 42, "vestage": 9502720,
    "categories": {
      "MALLOC_SMALL": {"dirty": 9437184, "swapped": 1048576, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
      "stack": {"dirty": 65536, "swapped": 0, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 3}}}],
  "unit": "byte", "bytes per unit": 1, "page size": 16384, "errors": [], "warnings": []})");

struct Written {
    std::string text, err;
    json document;  // discarded when the file is missing or no JSON
};

// The text formatter first, then the JSON one writing to `path`, as the program does.
Written reportWithJson(ReportRun &run, const fs::path &path, std::int64_t format = VSSummaryFormatFormatted,
                       std::int64_t options = 0) {
    testing::internal::CaptureStderr();
    Written w;
    w.text = run.report(format, options, std::make_unique<VSOutputFormatterJSON>(path.string()));
    w.err = testing::internal::GetCapturedStderr();
    w.document = json::parse(readFile(path), nullptr, false);
    return w;
}

} // namespace

TEST(JsonReport, WorkedExampleHoldsBytesWhateverTheTextFormat) {
    for (const auto &[format, options] : {std::pair<std::int64_t, std::int64_t>{VSSummaryFormatFormatted, 0},
                                          {VSSummaryFormatPages, VSOutputOptionSwapped | VSOutputOptionWired}}) {
        ScratchDir dir;
        const fs::path written = dir.path / "report.json";
        ReportRun run;
        run.fake.pageSize(4096);  // the process's own page size must win
        addDaemon(run);
        const Written w = reportWithJson(run, written, format, options);
        EXPECT_EQ(w.err, "");
        EXPECT_EQ(w.document, kDaemonDocument) << w.document.dump(2);
        // One compact line: exactly what the serialiser makes of it again.
        EXPECT_EQ(readFile(written), w.document.dump());
        EXPECT_EQ(entriesOf(written.parent_path()), std::set<std::string>{written.filename()});
    }
}

TEST(JsonReport, DocumentCases) {
    struct Case {
        const char *label;
        std::function<void(ReportRun &)> prepare;
        std::vector<std::pair<const char *, json>> expected;  // by JSON pointer; null: absent
    };
    const Case cases[] = {
        {"a failed process is listed bare, its errors follow the global ones; auxiliary data of healthy "
         "processes merged over aggregating figures",
         [](ReportRun &run) {
             addTroubledRun(run);
             run.gather();
             VSProcess::_addGlobalError("Vestage exited early due to SIGINT and did not finish gathering all data");
         },
         {{"/processes/1", json::parse(R"({"name": "worker", "pid": 7, "vestage": 0, "categories": {},
             "auxiliary": {}, "errors": ["worker [7]: task is gone"]})")},
          {"/processes/2/warnings", {"tool [5]: (zombie)"}},
          {"/processes/2/auxiliary", nullptr},
          {"/processes/0/auxiliary/phys_vestage", 10000},
          {"/auxiliary", json::parse(R"({"Kernel memory": {"KPRVT": 16384, "deeper": {"x": 0}}})")},
          {"/errors", {"Vestage exited early due to SIGINT and did not finish gathering all data",
                       "worker [7]: task is gone"}},
          {"/warnings", {"tool [5]: (zombie)"}},
          {"/total vestage", 9502720 + 8 * MiB + 80 * KiB},
          {"/phys_vestage_breakdown", true}}},

        {"shared memory counts in the vestage and the summary, in no process's categories; a category named "
         "total gives way to the totals in the summary only; a name that is not UTF-8 costs its stray byte",
         [](ReportRun &run) {
             run.process(10, "bad\xffname")
                 .region({.name = "total", .objectId = 1, .dirty = 16 * KiB})
                 .region({.name = "shm", .objectId = 50, .dirty = 64 * KiB, .swapped = 16 * KiB});
             run.process(11, "b").region({.name = "shm", .objectId = 50, .dirty = 64 * KiB, .swapped = 16 * KiB});
         },
         {{"/processes/0/name", "bad\ufffdname"},
          {"/processes/0/categories/total/regions", 1},
          {"/processes/1/vestage", 81920},
          {"/processes/1/categories", json::object()},
          {"/summary/shm/regions", 2},
          {"/summary/total/regions", 3},
          {"/summary/total/dirty", 98304},
          {"/total vestage", 98304},
          {"/phys_vestage_breakdown", nullptr}}},

    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ScratchDir dir;
        ReportRun run;
        c.prepare(run);
        const Written w = reportWithJson(run, dir.path / "out.json");
        EXPECT_EQ(w.err, "");
        ASSERT_FALSE(w.document.is_discarded());
        for (const auto &[pointer, value] : c.expected) {
            EXPECT_EQ(w.document.value(json::json_pointer(pointer), json()), value) << pointer << "\n"
                                                                                     << w.document.dump(2);
        }
    }
}

// A path that cannot be written costs one line on standard error and
// nothing else: the text report is whole, the previous document stays and
// no temporary file is left. The run is a child's that drops root (root
// writes anywhere); it reports by its exit status.
TEST(JsonReport, UnwritablePath) {
    ScratchDir dir;
    const fs::path path = dir.path / "report.json";
    writeFile(path, "previous");
    const pid_t child = fork();
    if (child == 0) {
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) {
            _exit(4);
        }
        ReportRun run;
        addDaemon(run);
        const Written w = reportWithJson(run, path);
        _exit((w.text == kDaemonFormatted ? 0 : 1) |
              (w.err == "Unable to serialize/write JSON data due to error: " + path.string() +
                                ": Permission denied\n"
                   ? 0
                   : 2));
    }
    int status = -1;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0) << "exit status 1: text report changed, 2: not the one line on standard error";
    EXPECT_EQ(readFile(path), "previous");
    EXPECT_EQ(entriesOf(dir.path), std::set<std::string>{"report.json"});
}
