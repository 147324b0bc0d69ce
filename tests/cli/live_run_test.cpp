// Whole runs against live children whose memory the test arranged, and interrupted.

#include <cinttypes>
#include <fstream>
#include <set>
#include <sys/ioctl.h>
#include <nlohmann/json.hpp>
#include <regex>

#include "tests/support/run_program.h"

namespace {

using vs::test::MemChild;
using vs::test::runProgram;

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// Dirty bytes of the `category` row of the first table after `from` in a
// report in the bytes format; 0 when the table has no such row.
uint64_t dirtyIn(const std::string &report, const std::string &from, const std::string &category) {
    const size_t at = report.find(from), end = report.find("    TOTAL\n", at);
    const size_t row = report.find("    " + category + "\n", at);
    if (at == std::string::npos || row == std::string::npos || row > end) return 0;
    return std::stoull(report.substr(report.rfind('\n', row) + 1));
}

// A parent and its child: private and shared memory as a user sees it, and
// the JSON document beside the text report telling the same.
TEST(LiveRun, PrivateAndSharedMemoryOfAParentAndItsChild) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const std::string bigPages = std::to_string((64u << 20) / kPage);
    MemChild parent({"anon:big:" + bigPages + ":" + bigPages, "shared:common:64", "fork:kid"});
    ASSERT_TRUE(parent.ready());
    const std::string parentName = "vs_memchild [" + std::to_string(parent.pid()) + "]";
    const std::string kidName = "vs_memchild [" + parent.fact("kid", "pid") + "]";
    vs::test::ScratchDir dir;
    auto run = runProgram({"-f", "bytes", "-p", std::to_string(parent.pid()), "--pid", parent.fact("kid", "pid"),
                           "--json", dir.path + "/report.json"});
    ASSERT_EQ(run.status, 0) << run.err;
    // The 64 MiB the parent wrote before the fork stay shared with its
    // child until one of them writes: not the parent's own memory but that
    // of the two together, counted once over the run.
    const std::string untagged = "untagged (\"VM_ALLOCATE\")";
    EXPECT_LT(dirtyIn(run.out, parentName + ": 64-bit", untagged), 1u << 20) << run.out;
    EXPECT_GE(dirtyIn(run.out, "Shared with " + kidName + ":\n", untagged), 64u << 20) << run.out;
    EXPECT_GE(dirtyIn(run.out, "Shared with " + parentName + ":\n", untagged), 64u << 20) << run.out;
    const uint64_t summed = dirtyIn(run.out, "Summary Vestage", untagged);
    EXPECT_GE(summed, 64u << 20) << run.out;
    EXPECT_LT(summed, 65u << 20) << "counted once: " << run.out;
    // The shared region is one object in a table shared by both, counted once.
    EXPECT_GE(dirtyIn(run.out, "Shared with " + kidName + ":\n", "TOTAL"), 64 * kPage) << run.out;

    // The document: processes in report order, each with the vestage its
    // header shows, and the summary's total (dirty includes swapped), the
    // last TOTAL row of the report.
    std::ifstream in(dir.path + "/report.json");
    const nlohmann::json document = nlohmann::json::parse(in, nullptr, false);
    ASSERT_FALSE(document.is_discarded());
    std::vector<std::pair<int64_t, int64_t>> textOrder, jsonOrder;
    const std::regex header(R"(^.* \[(\d+)\]: 64-bit\tVestage: (\d+) B)");
    std::istringstream lines(run.out);
    for (std::string line; std::getline(lines, line);) {
        std::smatch match;
        if (std::regex_search(line, match, header)) textOrder.emplace_back(std::stoll(match[1]), std::stoll(match[2]));
    }
    for (const auto &process : document.at("processes")) {
        jsonOrder.emplace_back(process.at("pid"), process.at("vestage"));
    }
    EXPECT_EQ(jsonOrder, textOrder);
    EXPECT_EQ(jsonOrder.size(), 2u);
    const uint64_t dirty = document.at("summary").at("total").at("dirty");
    EXPECT_EQ(document.at("total vestage"), dirty);
    const size_t lastTotal = run.out.rfind("    TOTAL\n");
    ASSERT_NE(lastTotal, std::string::npos);
    EXPECT_EQ(std::stoull(run.out.substr(run.out.rfind('\n', lastTotal) + 1)), dirty);
}

// Fork families as servers and worker pools make them: what the parent
// wrote counts once however many children map it, what a child wrote is
// its own, and a shared region written in parts is as large as all parts.
TEST(LiveRun, ForkFamiliesCountEachPageOnce) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    constexpr uint64_t MiB = 1u << 20;
    const uint64_t pages = 8 * MiB / kPage, tenth = pages / 10, quarter = pages / 4;
    const std::string n = std::to_string(pages);
    auto writes = [](const std::string &item, uint64_t first, uint64_t count) {
        return item + ":" + std::to_string(first) + ":" + std::to_string(count);
    };
    struct Scene {
        const char *what;
        std::vector<std::string> items;
        std::string category;
        uint64_t summary;   // the category in the summary, to within 1 MiB
        uint64_t childOwn;  // the category in each child's own table, to within 1 MiB
    };
    const std::string untagged = "untagged (\"VM_ALLOCATE\")";
    const Scene scenes[] = {
        {"children that only read", {"anon:a:" + n + ":" + n, "fork:c1", "fork:c2", "fork:c3"}, untagged, 8 * MiB, 0},
        {"children that each write a tenth",
         {"anon:a:" + n + ":" + n, writes("fork:c1:a", 0, tenth), writes("fork:c2:a", tenth, tenth),
          writes("fork:c3:a", 2 * tenth, tenth)},
         untagged, 8 * MiB + 3 * tenth * kPage, tenth * kPage},
        {"pages only read are the kernel's zero page, nobody's memory",
         {"anon:a:" + n + ":" + std::to_string(pages / 2) + ":" + std::to_string(pages / 2), "fork:c1", "fork:c2"},
         untagged, 4 * MiB, 0},
        {"a child that moved its copy elsewhere still shares it",
         {"anon:a:" + n + ":" + n, "fork:c1:a:move", "fork:c2"}, untagged, 8 * MiB, 0},
        {"a shared region written in quarters",
         {"shared:s:" + n + ":0", writes("fork:c1:s", 0, quarter), writes("fork:c2:s", quarter, quarter),
          writes("fork:c3:s", 2 * quarter, quarter), writes("fork:c4:s", 3 * quarter, quarter)},
         "/dev/zero mapping", 8 * MiB, 0},
    };
    for (const Scene &scene : scenes) {
        SCOPED_TRACE(scene.what);
        MemChild parent(scene.items);
        ASSERT_TRUE(parent.ready());
        std::vector<std::string> args = {"-f", "bytes", "-p", std::to_string(parent.pid())};
        std::vector<std::string> children;
        for (const char *label : {"c1", "c2", "c3", "c4"}) {
            if (!parent.fact(label, "pid").empty()) {
                children.push_back("vs_memchild [" + parent.fact(label, "pid") + "]");
                args.insert(args.end(), {"-p", parent.fact(label, "pid")});
            }
        }
        const auto run = runProgram(args);
        ASSERT_EQ(run.status, 0) << run.err;
        const uint64_t summed = dirtyIn(run.out, "Summary Vestage", scene.category);
        EXPECT_GE(summed, scene.summary) << run.out;
        EXPECT_LT(summed, scene.summary + MiB) << run.out;
        for (const std::string &child : children) {
            const uint64_t own = dirtyIn(run.out, child + ": 64-bit", scene.category);
            EXPECT_GE(own, scene.childOwn) << child << run.out;
            EXPECT_LT(own, scene.childOwn + MiB) << child << run.out;
        }
    }
}

// The file pages of `path` that process `pid` has mapped, by the kernel's
// page map (the kernel maps pages around the one read, so reads alone do
// not tell).
std::set<uint64_t> mappedFilePages(pid_t pid, const std::string &path) {
    std::set<uint64_t> pages;
    std::ifstream maps("/proc/" + std::to_string(pid) + "/maps");
    const int pagemap = open(("/proc/" + std::to_string(pid) + "/pagemap").c_str(), O_RDONLY);
    for (std::string line; pagemap >= 0 && std::getline(maps, line);) {
        if (line.size() < path.size() || line.compare(line.size() - path.size(), path.size(), path) != 0) continue;
        uint64_t start = 0, end = 0, offset = 0;
        char perms[5] = {};
        if (std::sscanf(line.c_str(), "%" SCNx64 "-%" SCNx64 " %4s %" SCNx64, &start, &end, perms, &offset) != 4) continue;
        for (uint64_t page = 0; page < (end - start) / kPage; ++page) {
            uint64_t entry = 0;
            if (pread(pagemap, &entry, sizeof entry, static_cast<off_t>((start / kPage + page) * sizeof entry)) ==
                    sizeof entry &&
                (entry >> 63) != 0) {
                pages.insert(offset / kPage + page);
            }
        }
    }
    if (pagemap >= 0) close(pagemap);
    return pages;
}

// A file of `pages` pages next to the test programs (a disk file system,
// whose pages are page cache), written to disk so that they are clean.
std::string cleanFile(const std::string &name, uint64_t pages) {
    const std::string path = VESTAGE_TEST_BIN_DIR "/" + name + "_" + std::to_string(getpid());
    {
        std::ofstream out(path, std::ios::binary);
        out << std::string(pages * kPage, 'w');
    }
    const int fd = open(path.c_str(), O_RDONLY);
    if (fd >= 0) {
        fsync(fd);
        close(fd);
    }
    return path;
}

// Dirty bytes, then clean bytes, of the summary's `category` row.
std::pair<uint64_t, uint64_t> summaryRow(const std::string &report, const std::string &category) {
    const size_t at = report.find("Summary Vestage"), row = report.find("    " + category + "\n", at);
    if (at == std::string::npos || row == std::string::npos) return {0, 0};
    std::istringstream fields(report.substr(report.rfind('\n', row) + 1));
    uint64_t dirty = 0, clean = 0;
    std::string unit;
    fields >> dirty >> unit >> clean;
    return {dirty, clean};
}

// A file that processes map privately and read in different parts: its page
// cache counts once, as the union of the pages they hold.
TEST(LiveRun, PrivateMappingsOfOneFileHoldTheUnionOfTheirPages) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const uint64_t pages = 64; // a multiple of the kernel's fault-around window
    const std::string path = cleanFile("vs_window_test", pages);
    auto reads = [&](uint64_t first, uint64_t count) {
        return "file:f:" + path + ":" + std::to_string(first) + ":" + std::to_string(count);
    };
    struct Scene {
        const char *what;
        std::vector<std::string> first, second;
        bool eachHoldsSome; // pages the other does not hold
    };
    const Scene scenes[] = {
        {"each reads its own end", {reads(0, 8)}, {reads(pages - 8, 8)}, true},
        {"both read the same half", {reads(0, pages / 2)}, {reads(0, pages / 2)}, false},
        {"one reads it all", {reads(0, pages)}, {reads(pages / 2, 4)}, false},
    };
    for (const Scene &scene : scenes) {
        SCOPED_TRACE(scene.what);
        MemChild a(scene.first), b(scene.second);
        ASSERT_TRUE(a.ready() && b.ready());
        // What the kernel says they hold, together and each.
        const std::set<uint64_t> heldByA = mappedFilePages(a.pid(), path), heldByB = mappedFilePages(b.pid(), path);
        std::set<uint64_t> held = heldByA;
        held.insert(heldByB.begin(), heldByB.end());
        EXPECT_EQ(held.size() > std::max(heldByA.size(), heldByB.size()), scene.eachHoldsSome);
        const auto run = runProgram({"-f", "bytes", "-p", std::to_string(a.pid()), "-p", std::to_string(b.pid())});
        ASSERT_EQ(run.status, 0) << run.err;
        const auto [dirty, clean] = summaryRow(run.out, "mapped file");
        EXPECT_EQ(dirty + clean, held.size() * kPage) << run.out;
    }
    unlink(path.c_str());
}

// The copies a process made of a privately mapped file are its own dirty
// memory, named after the file whether or not it still maps page cache.
TEST(LiveRun, CopiesOfAFileAreNamedAfterIt) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const uint64_t pages = 16;
    const std::string path = cleanFile("vs_copies_test", pages);
    MemChild child({"pfile:all:" + path + ":" + std::to_string(pages), "pfile:half:" + path + ":8"});
    ASSERT_TRUE(child.ready());
    const auto run = runProgram({"-f", "bytes", "-p", std::to_string(child.pid())});
    ASSERT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(dirtyIn(run.out, ": 64-bit", "mapped file"), (pages + 8) * kPage) << run.out;
    unlink(path.c_str());
}

// Without the right to read page frames, pages shared after fork stay each
// process's own, and the report says so once, in text and JSON alike.
TEST(LiveRun, SharingAfterForkUnresolvedWithoutRootIsSaid) {
    if (geteuid() != 0) GTEST_SKIP() << "the test drops to another user";
    constexpr uid_t kNobody = 65534;
    const std::string pages = std::to_string((8u << 20) / kPage);
    MemChild parent({"anon:big:" + pages + ":" + pages, "fork:kid"}, VESTAGE_TEST_BIN_DIR "/vs_memchild", kNobody);
    ASSERT_TRUE(parent.ready());
    const std::string note =
        "Pages shared after fork could not be told apart without the right to read page frames (run as root): "
        "each process counts them as its own";
    const std::string parentName = "vs_memchild [" + std::to_string(parent.pid()) + "]";
    vs::test::ScratchDir dir;
    ASSERT_EQ(chown(dir.path.c_str(), kNobody, kNobody), 0);
    const auto run = runProgram({"-f", "bytes", "-p", std::to_string(parent.pid()), "--pid", parent.fact("kid", "pid"),
                                 "--json", dir.path + "/report.json"},
                                {.user = kNobody});
    ASSERT_EQ(run.status, 0) << run.err;
    EXPECT_NE(run.out.find("\nNotes:\n\t" + note + "\n"), std::string::npos) << run.out;
    EXPECT_EQ(run.out.find("may be invalid"), std::string::npos) << "a note is no error: " << run.out;
    EXPECT_GE(dirtyIn(run.out, parentName + ": 64-bit", "untagged (\"VM_ALLOCATE\")"), 8u << 20) << run.out;
    std::ifstream in(dir.path + "/report.json");
    const nlohmann::json document = nlohmann::json::parse(in, nullptr, false);
    ASSERT_FALSE(document.is_discarded());
    EXPECT_EQ(document.value("notes", nlohmann::json::array()), nlohmann::json::array({note}));
}

// Shared memory that users create by name is shown under that name, in the
// text report and the JSON document alike.
TEST(LiveRun, NamedSharedMemoryIsShownByItsName) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const std::string shm = "vs_live_test_pool_" + std::to_string(getpid());
    MemChild child({"shm:p:" + shm + ":2", "memfd:m:ring:3", "sysv:s:4"});
    ASSERT_TRUE(child.ready());
    vs::test::ScratchDir dir;
    const auto run = runProgram({"-f", "bytes", "-p", std::to_string(child.pid()), "--json", dir.path + "/r.json"});
    ASSERT_EQ(run.status, 0) << run.err;
    std::ifstream in(dir.path + "/r.json");
    const nlohmann::json document = nlohmann::json::parse(in, nullptr, false);
    ASSERT_FALSE(document.is_discarded());
    const auto &categories = document.at("processes").at(0).at("categories");
    const std::pair<std::string, uint64_t> expected[] = {
        {"shared memory /dev/shm/" + shm, 2 * kPage},
        {"shared memory memfd:ring", 3 * kPage},
        {"shared memory SYSV00000000 (key 0x00000000)", 4 * kPage},
    };
    for (const auto &[name, dirty] : expected) {
        EXPECT_EQ(dirtyIn(run.out, "vs_memchild", name), dirty) << name << "\n" << run.out;
        ASSERT_TRUE(categories.contains(name)) << name;
    }
    unlink(("/dev/shm/" + shm).c_str());
}

// "--json -": the document on standard output, and nothing else there.
TEST(LiveRun, JsonOnStandardOutputIsTheWholeOutput) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    MemChild child({"anon:a:4:4"});
    ASSERT_TRUE(child.ready());
    vs::test::ScratchDir dir;
    const auto run = runProgram({"-p", std::to_string(child.pid()), "--json", "-"}, {.workingDirectory = dir.path});
    ASSERT_EQ(run.status, 0) << run.err;
    const nlohmann::json document = nlohmann::json::parse(run.out, nullptr, false);
    ASSERT_FALSE(document.is_discarded()) << run.out;
    EXPECT_EQ(document.at("processes").at(0).at("pid"), child.pid());
    EXPECT_FALSE(std::filesystem::exists(dir.path + "/-")) << "no file named -";
}

// A report that cannot be written whole is an error, not a success.
TEST(LiveRun, ReportThatCannotBeWrittenFailsTheRun) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    MemChild child({"anon:a:4:4"});
    ASSERT_TRUE(child.ready());
    const auto run = runProgram({"-p", std::to_string(child.pid())}, {.standardOutput = "/dev/full"});
    EXPECT_EQ(run.status, 1);
    EXPECT_EQ(run.err, "vestage: cannot write the report to standard output: No space left on device\n");
}

// Far more targets than fds: a run allowed 64 reads every one of 400
// processes, and none is lost for want of an fd.
TEST(LiveRun, MoreTargetsThanTheFileLimitAllows) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    constexpr int kChildren = 400;
    std::vector<std::string> items{"anon:a:4:4"};
    for (int i = 0; i < kChildren; ++i) items.push_back("fork:k" + std::to_string(i));
    MemChild parent(items);
    ASSERT_TRUE(parent.ready());
    std::vector<std::string> pids{std::to_string(parent.pid())};
    for (int i = 0; i < kChildren; ++i) pids.push_back(parent.fact("k" + std::to_string(i), "pid"));
    const auto run = runProgram({"-t", "-p", pids.front()}, {.fileLimit = 64});
    ASSERT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.err, "");
    const size_t error = run.out.find("Errors were encountered");
    EXPECT_EQ(error, std::string::npos) << run.out.substr(error == std::string::npos ? 0 : error, 2000);
    std::vector<std::string> missing;
    for (const std::string &pid : pids) {
        if (pid.empty() || run.out.find("vs_memchild [" + pid + "]: ") == std::string::npos) missing.push_back(pid);
    }
    EXPECT_TRUE(missing.empty()) << missing.size() << " of " << pids.size() << " not reported, e.g. " << missing[0];
}

// The program never reads itself, neither among all processes nor when
// its own name is asked for.
TEST(LiveRun, TheProgramLeavesItselfOut) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    const std::string thisTest = "[" + std::to_string(getpid()) + "]: ";
    const std::pair<std::vector<std::string>, bool> cases[] = {{{"-a"}, true}, {{"-p", "vestage"}, false}};
    for (const auto &[args, listsThisTest] : cases) {
        SCOPED_TRACE(args.back());
        const auto run = runProgram(args);
        const std::string self = "[" + std::to_string(run.pid) + "]";
        EXPECT_EQ(run.out.find(self), std::string::npos)
            << self << " in:\n" << run.out.substr(0, run.out.find(self) + 200);
        EXPECT_EQ(run.err.find(self), std::string::npos) << run.err;
        if (listsThisTest) {
            EXPECT_NE(run.out.find(thisTest), std::string::npos) << "other processes are read";
        }
    }
}

// Started with SIGINT ignored, as a background job of a script is: once
// gathering is over an interrupt ends the program again.
TEST(LiveRun, InterruptEndsThePrintingEvenWhenStartedIgnored) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    int out[2];
    ASSERT_EQ(pipe2(out, O_CLOEXEC), 0);
    fcntl(out[1], F_SETPIPE_SZ, 4096);  // the report fills it long before its end
    const pid_t pid = fork();
    if (pid == 0) {
        signal(SIGINT, SIG_IGN);
        dup2(out[1], 1);
        const int devNull = open("/dev/null", O_RDWR | O_CLOEXEC);
        dup2(devNull, 0);
        dup2(devNull, 2);
        execl(VESTAGE_TEST_BIN_DIR "/vestage", "vestage", "-a", "-v", static_cast<char *>(nullptr));
        _exit(127);
    }
    close(out[1]);
    // Wait until the report has filled the pipe: gathering is over, and the
    // program is held in its first writes.
    const int capacity = fcntl(out[0], F_GETPIPE_SZ);
    for (int queued = 0; queued < capacity;) {
        ASSERT_EQ(waitpid(pid, nullptr, WNOHANG), 0) << "ended before its report filled the pipe";
        ASSERT_EQ(ioctl(out[0], FIONREAD, &queued), 0);
        usleep(1000);
    }
    std::ifstream status("/proc/" + std::to_string(pid) + "/status");
    std::string line, ignored;
    while (std::getline(status, line)) {
        if (line.rfind("SigIgn:", 0) == 0) ignored = line.substr(7);
    }
    const bool stillIgnored = (std::stoull(ignored, nullptr, 16) & (1ull << (SIGINT - 1))) != 0;
    // Ignored, SIGINT would leave it blocked on the pipe for good.
    kill(pid, stillIgnored ? SIGKILL : SIGINT);
    EXPECT_FALSE(stillIgnored) << "SIGINT still ignored after gathering";
    int wait = 0;
    ASSERT_EQ(waitpid(pid, &wait, 0), pid);
    EXPECT_TRUE(WIFSIGNALED(wait) && WTERMSIG(wait) == SIGINT) << wait;
    close(out[0]);
}

TEST(LiveRun, InterruptDuringGatheringStillReports) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    // SIGINT pending from the start: met as soon as the program listens for it.
    auto run = runProgram({"-a"}, {.blockInterrupt = true, .signalAfterStart = SIGINT});
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_NE(run.err.find("Exiting early due to SIGINT\n"), std::string::npos) << run.err;
    EXPECT_NE(run.out.find("\tVestage exited early due to SIGINT and did not finish gathering all data\n"),
              std::string::npos)
        << run.out;
    EXPECT_NE(run.out.find("TOTAL"), std::string::npos);
}

}  // namespace
