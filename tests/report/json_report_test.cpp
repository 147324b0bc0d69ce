// The JSON document: whole runs of the driver over prepared targets, the
// document read back and compared as parsed values (key order is free), and
// the file handling of the write: what is replaced, what is written in place,
// and that a failed write leaves the previous document and no debris.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <set>
#include <sstream>

#include <nlohmann/json.hpp>

#include "output/json_formatter.h"
#include "tests/report/report_support.h"

using namespace report_test;
using nlohmann::json;
namespace fs = std::filesystem;

namespace {

// A fresh directory under /tmp, removed with everything in it.
class ScratchDir {
public:
    ScratchDir() {
        char pattern[] = "/tmp/vestage-json-XXXXXX";
        const char *made = mkdtemp(pattern);
        EXPECT_NE(made, nullptr);
        _path = made != nullptr ? made : "/tmp";
        // Traversable by the unprivileged child of the failure tests.
        fs::permissions(_path, fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                   fs::perms::others_read | fs::perms::others_exec);
    }
    ~ScratchDir() {
        std::error_code ignored;
        // Locked directories must be opened up before they can be emptied.
        for (const auto &entry : fs::recursive_directory_iterator(_path, ignored)) {
            if (entry.is_directory(ignored) && !entry.is_symlink(ignored)) {
                fs::permissions(entry.path(), fs::perms::owner_all, fs::perm_options::add, ignored);
            }
        }
        fs::remove_all(_path, ignored);
    }
    ScratchDir(const ScratchDir &) = delete;
    ScratchDir &operator=(const ScratchDir &) = delete;
    const fs::path &path() const { return _path; }

private:
    fs::path _path;
};

std::string readFile(const fs::path &path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

void writeFile(const fs::path &path, const std::string &text) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << text;
}

std::set<std::string> entriesOf(const fs::path &directory) {
    std::set<std::string> names;
    std::error_code ignored;
    for (const auto &entry : fs::directory_iterator(directory, ignored)) {
        names.insert(entry.path().filename().string());
    }
    return names;
}

// The daemon of the worked example: MALLOC_SMALL 8 MiB dirty and 1 MiB
// swapped in two regions, stack 64 KiB dirty, 16 KiB clean and 16 KiB wired
// in three; 16 KiB pages.
PreparedProcess &addDaemon(ReportRun &run) {
    return run.process(42, "daemon")
        .region({.name = "MALLOC_SMALL", .objectId = 1, .dirty = 4 * MiB, .swapped = 512 * KiB})
        .region({.name = "MALLOC_SMALL", .objectId = 2, .dirty = 4 * MiB, .swapped = 512 * KiB})
        .region({.name = "stack", .objectId = 3, .dirty = 64 * KiB})
        .region({.name = "stack", .objectId = 4, .clean = 16 * KiB, .wired = 16 * KiB})
        .region({.name = "stack", .objectId = 5});
}

const char *const kDaemonDocument = R"({
  "total vestage": 9502720,
  "summary": {
    "MALLOC_SMALL": {"dirty": 9437184, "swapped": 1048576, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
    "stack": {"dirty": 65536, "swapped": 0, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 3},
    "total": {"dirty": 9502720, "swapped": 1048576, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 5}},
  "processes": [{"name": "daemon", "pid": 42, "vestage": 9502720,
    "categories": {
      "MALLOC_SMALL": {"dirty": 9437184, "swapped": 1048576, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
      "stack": {"dirty": 65536, "swapped": 0, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 3}}}],
  "unit": "byte", "bytes per unit": 1, "page size": 16384, "errors": [], "warnings": []})";

struct RunResult {
    std::string text;     // the text report
    std::string file;     // the JSON file as written
    std::string stderrText;
};

// Runs the report the way the program does: the text formatter first, then
// the JSON formatter writing to `path`.
RunResult reportWithJson(ReportRun &run, const fs::path &path, std::int64_t format = VSSummaryFormatFormatted,
                         std::int64_t options = 0, bool summarize = false) {
    if (!run.vestage) {
        run.gather();
    }
    CapturedStream output;
    auto text = std::make_unique<VSOutputFormatterText>(format, options);
    text->setOutput(output.stream());
    run.vestage->addOutputFormatter(std::move(text));
    run.vestage->addOutputFormatter(std::make_unique<VSOutputFormatterJSON>(path.string()));
    testing::internal::CaptureStderr();
    run.vestage->printOutputVerbose(false, summarize);
    RunResult result;
    result.stderrText = testing::internal::GetCapturedStderr();
    result.text = output.text();
    std::error_code ignored;
    if (fs::is_regular_file(path, ignored)) {
        result.file = readFile(path);
    }
    return result;
}

} // namespace

TEST(JsonReport, WorkedExampleHoldsBytesWhateverTheTextFormat) {
    struct Case {
        const char *label;
        std::int64_t format;
        std::int64_t options;
    };
    const Case cases[] = {
        {"formatted", VSSummaryFormatFormatted, 0},
        {"bytes", VSSummaryFormatBytes, 0},
        {"pages", VSSummaryFormatPages, 0},
        {"pages, wide", VSSummaryFormatPages, VSOutputOptionSwapped | VSOutputOptionWired},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ScratchDir dir;
        ReportRun run;
        run.fake.pageSize(4096); // the process's own page size must win
        addDaemon(run);
        const RunResult result = reportWithJson(run, dir.path() / "report.json", c.format, c.options);
        EXPECT_EQ(result.stderrText, "");
        const json document = json::parse(result.file, nullptr, false);
        ASSERT_FALSE(document.is_discarded()) << result.file;
        EXPECT_EQ(document, json::parse(kDaemonDocument)) << document.dump(2);
        // One compact line: exactly what the serialiser makes of it again.
        EXPECT_EQ(result.file, document.dump());
        EXPECT_EQ(entriesOf(dir.path()), std::set<std::string>{"report.json"});
    }
}

TEST(JsonReport, DocumentCases) {
    using vs::makeAuxData, vs::makeAuxDictionary;
    struct Case {
        const char *label;
        std::function<void(ReportRun &)> prepare;
        const char *expected;
    };
    const Case cases[] = {
        {"a failed process is listed bare and its errors follow the global ones",
         [](ReportRun &run) {
             addDaemon(run);
             run.process(7, "worker")
                 .error("worker: task refused")
                 .error("worker: regions unreadable")
                 .warning("worker: exited while being read")
                 .aux(makeAuxDictionary({{"kept", makeAuxData(5, true)}}));
             run.gather();
             VSProcess::_addGlobalError("Vestage exited early due to SIGINT and did not finish gathering all data");
         },
         R"({"total vestage": 9502720,
             "summary": {
               "MALLOC_SMALL": {"dirty": 9437184, "swapped": 1048576, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
               "stack": {"dirty": 65536, "swapped": 0, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 3},
               "total": {"dirty": 9502720, "swapped": 1048576, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 5}},
             "processes": [
               {"name": "daemon", "pid": 42, "vestage": 9502720,
                "categories": {
                  "MALLOC_SMALL": {"dirty": 9437184, "swapped": 1048576, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
                  "stack": {"dirty": 65536, "swapped": 0, "clean": 16384, "reclaimable": 0, "wired": 16384, "regions": 3}}},
               {"name": "worker", "pid": 7, "vestage": 0, "categories": {}, "auxiliary": {},
                "errors": ["worker: task refused", "worker: regions unreadable"],
                "warnings": ["worker: exited while being read"]}],
             "unit": "byte", "bytes per unit": 1, "page size": 16384,
             "errors": ["Vestage exited early due to SIGINT and did not finish gathering all data",
                        "worker: task refused", "worker: regions unreadable"],
             "warnings": ["worker: exited while being read"]})"},

        {"warnings without errors, auxiliary data present, empty and absent, page size of the first listed",
         [](ReportRun &run) {
             run.process(5, "big", 16384)
                 .region({.name = "heap", .objectId = 1, .dirty = 64 * KiB})
                 .warning("big: became a zombie")
                 .aux(makeAuxDictionary({
                     {"Kernel memory", makeAuxDictionary({{"KPRVT", makeAuxData(4096, true)},
                                                          {"KSHRD", makeAuxData(8192, false)}})},
                     {"phys_vestage", makeAuxData(10000, false)},
                 }));
             run.process(6, "middle", 4096)
                 .region({.name = "heap", .objectId = 2, .dirty = 32 * KiB})
                 .warning("middle: exited while being read")
                 .aux(makeAuxDictionary({}));
             run.process(9, "small", 65536).region({.name = "heap", .objectId = 3, .dirty = 16 * KiB});
         },
         R"({"total vestage": 114688,
             "summary": {
               "heap": {"dirty": 114688, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 3},
               "total": {"dirty": 114688, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 3}},
             "processes": [
               {"name": "big", "pid": 5, "vestage": 65536,
                "categories": {"heap": {"dirty": 65536, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1}},
                "auxiliary": {"Kernel memory": {"KPRVT": 4096, "KSHRD": 8192}, "phys_vestage": 10000},
                "warnings": ["big: became a zombie"]},
               {"name": "middle", "pid": 6, "vestage": 32768,
                "categories": {"heap": {"dirty": 32768, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1}},
                "auxiliary": {},
                "warnings": ["middle: exited while being read"]},
               {"name": "small", "pid": 9, "vestage": 16384,
                "categories": {"heap": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1}}}],
             "auxiliary": {"Kernel memory": {"KPRVT": 4096}},
             "unit": "byte", "bytes per unit": 1, "page size": 16384, "errors": [],
             "warnings": ["big: became a zombie", "middle: exited while being read"]})"},

        {"shared memory counts in the vestage and the summary, in no process's categories",
         [](ReportRun &run) {
             run.process(10, "a")
                 .region({.name = "mine", .objectId = 1, .dirty = 16 * KiB})
                 .region({.name = "shm", .objectId = 50, .dirty = 64 * KiB, .swapped = 16 * KiB});
             run.process(11, "b").region({.name = "shm", .objectId = 50, .dirty = 64 * KiB, .swapped = 16 * KiB});
         },
         R"({"total vestage": 98304,
             "summary": {
               "mine": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1},
               "shm": {"dirty": 81920, "swapped": 16384, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 2},
               "total": {"dirty": 98304, "swapped": 16384, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 3}},
             "processes": [
               {"name": "a", "pid": 10, "vestage": 98304,
                "categories": {"mine": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1}}},
               {"name": "b", "pid": 11, "vestage": 81920, "categories": {}}],
             "unit": "byte", "bytes per unit": 1, "page size": 16384, "errors": [], "warnings": []})"},

        {"a category named total gives way to the totals in the summary only, breakdown switch on",
         [](ReportRun &run) {
             run.fake.setting("vm.self_region_vestage", 1);
             run.process(3, "p")
                 .region({.name = "total", .objectId = 1, .dirty = 16 * KiB})
                 .region({.name = "other", .objectId = 2, .clean = 32 * KiB, .reclaimable = 16 * KiB});
         },
         R"({"total vestage": 16384,
             "summary": {
               "other": {"dirty": 0, "swapped": 0, "clean": 32768, "reclaimable": 16384, "wired": 0, "regions": 1},
               "total": {"dirty": 16384, "swapped": 0, "clean": 32768, "reclaimable": 16384, "wired": 0, "regions": 2}},
             "processes": [
               {"name": "p", "pid": 3, "vestage": 16384,
                "categories": {
                  "total": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1},
                  "other": {"dirty": 0, "swapped": 0, "clean": 32768, "reclaimable": 16384, "wired": 0, "regions": 1}}}],
             "unit": "byte", "bytes per unit": 1, "page size": 16384, "errors": [], "warnings": [],
             "phys_vestage_breakdown": true})"},

        {"a name that is not UTF-8 costs its stray byte, not the document",
         [](ReportRun &run) { run.process(4, "bad\xffname").region({.name = "heap", .objectId = 1, .dirty = 16 * KiB}); },
         R"({"total vestage": 16384,
             "summary": {
               "heap": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1},
               "total": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1}},
             "processes": [
               {"name": "bad\ufffdname", "pid": 4, "vestage": 16384,
                "categories": {"heap": {"dirty": 16384, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 1}}}],
             "unit": "byte", "bytes per unit": 1, "page size": 16384, "errors": [], "warnings": []})"},

        {"no targets: the kernel's page size stays",
         [](ReportRun &run) { run.fake.pageSize(8192); },
         R"({"total vestage": 0,
             "summary": {"total": {"dirty": 0, "swapped": 0, "clean": 0, "reclaimable": 0, "wired": 0, "regions": 0}},
             "processes": [],
             "unit": "byte", "bytes per unit": 1, "page size": 8192, "errors": [], "warnings": []})"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ScratchDir dir;
        ReportRun run;
        c.prepare(run);
        const RunResult result = reportWithJson(run, dir.path() / "out.json");
        EXPECT_EQ(result.stderrText, "");
        const json document = json::parse(result.file, nullptr, false);
        ASSERT_FALSE(document.is_discarded()) << result.file;
        EXPECT_EQ(document, json::parse(c.expected)) << document.dump(2);
    }
}

// Where a good write lands: a file is replaced as a whole, a link keeps
// pointing at its (rewritten) target, and a pipe is written into rather
// than replaced by a file.
TEST(JsonReport, WriteTargets) {
    struct Case {
        const char *label;
        // Prepares the directory and returns the path to hand over.
        std::function<fs::path(const fs::path &)> prepare;
        // The file the document must end up in.
        const char *documentFile;
        std::set<std::string> entriesAfter;
    };
    const Case cases[] = {
        {"a new file", [](const fs::path &d) { return d / "new.json"; }, "new.json", {"new.json"}},
        {"an existing file, longer than the document, keeps its permissions",
         [](const fs::path &d) {
             writeFile(d / "old.json", std::string(100000, 'x'));
             fs::permissions(d / "old.json", fs::perms::owner_read | fs::perms::owner_write | fs::perms::group_read);
             return d / "old.json";
         },
         "old.json", {"old.json"}},
        {"a symbolic link to a file in another directory",
         [](const fs::path &d) {
             fs::create_directory(d / "real");
             writeFile(d / "real" / "target.json", "old");
             fs::create_symlink("real/target.json", d / "link.json");
             return d / "link.json";
         },
         "real/target.json", {"link.json", "real"}},
        {"a relative path",
         [](const fs::path &d) {
             fs::current_path(d);
             return fs::path("relative.json");
         },
         "relative.json", {"relative.json"}},
    };
    const fs::path startDirectory = fs::current_path();
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ScratchDir dir;
        ReportRun run;
        addDaemon(run);
        const fs::path path = c.prepare(dir.path());
        std::error_code ignored;
        const fs::perms permissionsBefore = fs::status(dir.path() / c.documentFile, ignored).permissions();
        const RunResult result = reportWithJson(run, path);
        fs::current_path(startDirectory);
        EXPECT_EQ(result.stderrText, "");
        EXPECT_EQ(json::parse(readFile(dir.path() / c.documentFile), nullptr, false), json::parse(kDaemonDocument));
        EXPECT_EQ(entriesOf(dir.path()), c.entriesAfter);
        if (fs::is_symlink(dir.path() / "link.json")) {
            EXPECT_EQ(entriesOf(dir.path() / "real"), std::set<std::string>{"target.json"});
        }
        if (permissionsBefore != fs::perms::unknown) {
            EXPECT_EQ(fs::status(dir.path() / c.documentFile).permissions(), permissionsBefore);
        }
    }
}

TEST(JsonReport, PipeIsWrittenInPlace) {
    ScratchDir dir;
    const fs::path fifo = dir.path() / "pipe";
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    // A reader that never blocks lets the writer open the pipe at once; the
    // small document fits in the pipe's buffer.
    const int reader = open(fifo.c_str(), O_RDONLY | O_NONBLOCK);
    ASSERT_GE(reader, 0);
    ReportRun run;
    addDaemon(run);
    const RunResult result = reportWithJson(run, fifo);
    std::string received;
    char buffer[4096];
    for (ssize_t n; (n = read(reader, buffer, sizeof buffer)) > 0;) {
        received.append(buffer, static_cast<std::size_t>(n));
    }
    close(reader);
    EXPECT_EQ(result.stderrText, "");
    EXPECT_TRUE(fs::is_fifo(fifo));
    EXPECT_EQ(json::parse(received, nullptr, false), json::parse(kDaemonDocument));
    EXPECT_EQ(entriesOf(dir.path()), std::set<std::string>{"pipe"});
}

namespace {

struct ChildOutcome {
    int status = -1;
    std::string stderrText;
};

// Calls end() in a child process, so that privileges can be dropped (root
// writes anywhere) and resource limits set without touching the test
// process. The child's standard error is collected.
ChildOutcome endInChild(VSOutputFormatterJSON &formatter, bool unprivileged, std::function<void()> setUp) {
    int pipeEnds[2];
    if (pipe(pipeEnds) != 0) {
        ADD_FAILURE() << "pipe";
        return {};
    }
    std::fflush(stderr);
    const pid_t child = fork();
    if (child == 0) {
        close(pipeEnds[0]);
        dup2(pipeEnds[1], STDERR_FILENO);
        if (unprivileged && geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) {
            _exit(90);
        }
        if (setUp) {
            setUp();
        }
        formatter.end();
        std::fflush(stderr);
        _exit(0);
    }
    close(pipeEnds[1]);
    ChildOutcome outcome;
    char buffer[512];
    for (ssize_t n; (n = read(pipeEnds[0], buffer, sizeof buffer)) > 0;) {
        outcome.stderrText.append(buffer, static_cast<std::size_t>(n));
    }
    close(pipeEnds[0]);
    waitpid(child, &outcome.status, 0);
    return outcome;
}

} // namespace

// A path that cannot be written costs one line on standard error and
// nothing else: the previous document stays as it was, no temporary file is
// left behind, and end() returns normally.
TEST(JsonReport, UnwritablePaths) {
    constexpr const char *kGood = R"({"previous":"document"})";
    const auto locked = fs::perms::owner_read | fs::perms::owner_exec | fs::perms::group_read |
                        fs::perms::group_exec | fs::perms::others_read | fs::perms::others_exec;
    struct Case {
        const char *label;
        // Prepares the directory and returns the path to hand over.
        std::function<fs::path(const fs::path &)> prepare;
        bool unprivileged;
        std::function<void()> setUp;
        const char *reason;
    };
    const Case cases[] = {
        {"directory not writable",
         [&](const fs::path &d) {
             fs::create_directory(d / "locked");
             writeFile(d / "locked" / "report.json", kGood);
             // The file itself is writable: only the directory refuses.
             fs::permissions(d / "locked" / "report.json", fs::perms::all);
             fs::permissions(d / "locked", locked);
             return d / "locked" / "report.json";
         },
         true, nullptr, "Permission denied"},
        {"file not writable in a writable directory",
         [&](const fs::path &d) {
             fs::create_directory(d / "open");
             writeFile(d / "open" / "report.json", kGood);
             fs::permissions(d / "open", fs::perms::all);
             fs::permissions(d / "open" / "report.json", fs::perms::owner_read | fs::perms::group_read |
                                                             fs::perms::others_read);
             return d / "open" / "report.json";
         },
         true, nullptr, "Permission denied"},
        {"write fails part way",
         [&](const fs::path &d) {
             fs::create_directory(d / "small");
             writeFile(d / "small" / "report.json", kGood);
             return d / "small" / "report.json";
         },
         false,
         [] {
             signal(SIGXFSZ, SIG_IGN);
             rlimit limit{};
             getrlimit(RLIMIT_FSIZE, &limit);
             limit.rlim_cur = 64;
             setrlimit(RLIMIT_FSIZE, &limit);
         },
         "File too large"},
        {"directory missing", [](const fs::path &d) { return d / "missing" / "report.json"; }, false, nullptr,
         "No such file or directory"},
        {"path names a directory",
         [](const fs::path &d) {
             fs::create_directory(d / "report.json");
             return d / "report.json";
         },
         false, nullptr, "Is a directory"},
        {"empty path", [](const fs::path &) { return fs::path(); }, false, nullptr, "No such file or directory"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        ScratchDir dir;
        ReportRun run;
        const fs::path path = c.prepare(dir.path());
        const fs::path directory = path.has_parent_path() ? path.parent_path() : dir.path();
        const std::set<std::string> entriesBefore = entriesOf(directory);
        const std::set<std::string> topEntriesBefore = entriesOf(dir.path());
        std::error_code ignored;
        const bool hadFile = fs::is_regular_file(path, ignored);

        VSOutputFormatterJSON formatter(path.string());
        auto process = std::make_unique<PreparedProcess>(42, "daemon", 16384, true);
        formatter.printProcessHeader(*process);
        formatter.printProcessTotal(12345, *process);
        formatter.printGlobalAuxData(nullptr);
        const ChildOutcome outcome = endInChild(formatter, c.unprivileged, c.setUp);

        EXPECT_TRUE(WIFEXITED(outcome.status) && WEXITSTATUS(outcome.status) == 0) << outcome.status;
        EXPECT_EQ(outcome.stderrText,
                  std::string("Unable to serialize/write JSON data due to error: ") + c.reason + "\n");
        EXPECT_EQ(entriesOf(directory), entriesBefore);
        EXPECT_EQ(entriesOf(dir.path()), topEntriesBefore);
        if (hadFile) {
            fs::permissions(directory, fs::perms::owner_all, fs::perm_options::add, ignored);
            EXPECT_EQ(readFile(path), kGood);
        }
    }
}

TEST(JsonReport, FailedWriteLeavesTheTextReportWhole) {
    ScratchDir dir;
    std::string textAlone;
    {
        ReportRun run;
        addDaemon(run);
        run.process(7, "other").region({.name = "heap", .objectId = 9, .dirty = 16 * KiB});
        textAlone = run.report();
    }
    ReportRun run;
    addDaemon(run);
    run.process(7, "other").region({.name = "heap", .objectId = 9, .dirty = 16 * KiB});
    const RunResult result = reportWithJson(run, dir.path() / "missing" / "report.json");
    EXPECT_EQ(result.stderrText, "Unable to serialize/write JSON data due to error: No such file or directory\n");
    EXPECT_EQ(result.text, textAlone);
    EXPECT_EQ(entriesOf(dir.path()), std::set<std::string>{});
}
