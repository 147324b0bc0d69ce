// The program as a crash helper: the handed-over descriptor checked, a
// simulated hand-over, a real crash routed through the kernel's core_pattern.

#include <sys/syscall.h>
#include <sys/utsname.h>

#include <fstream>
#include <nlohmann/json.hpp>

#include "tests/support/run_program.h"

namespace {

using nlohmann::json;
using vs::test::runProgram;
using vs::test::ScratchDir;

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
constexpr int kCrasherPages = 256;

int openPidfd(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

// A vs_crasher child with its pages written: stopped, or waiting to crash.
struct Crasher : vs::test::MemChild {
    explicit Crasher(const std::string &mode)
        : MemChild({std::to_string(kCrasherPages), mode}, VESTAGE_TEST_BIN_DIR "/vs_crasher") {
        int status = 0;
        stopped = mode == "stop" && waitpid(pid(), &status, WUNTRACED) == pid() && WIFSTOPPED(status);
    }
    bool stopped = false;
};

// A report holding exactly the corpse (at least the pages the crasher wrote;
// no diagnostics, physical vestage or kernel counters), or no process.
void expectCorpseReport(const std::string &path, const std::string &name, pid_t pid, bool reported = true) {
    std::ifstream in(path);
    const json report = json::parse(in, nullptr, false);
    ASSERT_FALSE(report.is_discarded()) << "no report at " << path;
    EXPECT_EQ(report.value("errors", json::array()), json::array()) << report.dump();
    ASSERT_EQ(report.value("processes", json::array()).size(), reported ? 1u : 0u) << report.dump();
    for (const json &process : report["processes"]) {
        EXPECT_EQ(process.value("name", ""), name);
        EXPECT_EQ(process.value("pid", 0), pid);
        EXPECT_GE(process.value("vestage", uint64_t{0}), kCrasherPages * kPage) << process.dump();
        for (const char *key : {"errors", "warnings", "auxiliary"}) EXPECT_FALSE(process.contains(key)) << key;
    }
}

// Good arguments, but on descriptor 3 nothing, /dev/null (standard input)
// or the pidfd of a process already reaped.
TEST(CorpseRun, UnusableDescriptorEndsTheRun) {
    const pid_t reaped = fork();
    if (reaped == 0) _exit(0);
    const int reapedPidfd = openPidfd(reaped);
    waitpid(reaped, nullptr, 0);
    ASSERT_GE(reapedPidfd, 0);
    for (int descriptor3 : {-1, 0, reapedPidfd}) {
        const auto run = runProgram({"--corpsePid", std::to_string(reaped), "--corpseName", "crashy"},
                                    {.descriptor3 = descriptor3});
        EXPECT_EQ(run.err, "Failed to retrieve corpse port\n") << descriptor3;
        EXPECT_EQ(run.out.rfind("Usage: vestage --corpsePid pid --corpseName name", 0), 0u) << run.out;
        EXPECT_EQ(run.status, 1);
    }
    close(reapedPidfd);
}

TEST(CorpseRun, HandedOverSnapshotIsReportedInTheJsonFile) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    const struct Case {
        bool closeOutputs, closeInput;  // output open: the text report labels the snapshot
        std::vector<std::string> moreArgs = {};
        bool reported = true;
    } cases[] = {
        {false, false},
        {true, false},  // as a crash helper
        {true, true},
        // The snapshot is never analysed beside the live process under its pid.
        {true, false, {"-p", "PID", "-x", "init"}},
        // Idle-exit state comes from the handed-in flags: clean, so -s drops it.
        {true, false, {"--corpseDirtyFlags", "3", "-s"}, false},
        {true, false, {"--corpseDirtyFlags", "7", "-s"}},
    };
    for (const Case &c : cases) {
        Crasher child("stop");
        ASSERT_TRUE(child.stopped);
        const std::string pid = std::to_string(child.pid());
        const int pidfd = openPidfd(child.pid());
        ASSERT_GE(pidfd, 0) << std::strerror(errno);
        ScratchDir directory;
        std::vector<std::string> args = {"--corpsePid", pid, "--corpseName", "crashy", "--corpseProcFlags", "4",
                                         "--json", directory.path + "/r.json"};
        for (const std::string &more : c.moreArgs) args.push_back(more == "PID" ? pid : more);
        SCOPED_TRACE(::testing::PrintToString(args) + (c.closeInput ? ", all streams closed" : ""));
        const auto run =
            runProgram(args, {.descriptor3 = pidfd, .closeOutputs = c.closeOutputs, .closeInput = c.closeInput});
        close(pidfd);
        EXPECT_EQ(run.status, 0);
        if (!c.closeOutputs) {
            EXPECT_EQ(run.err, "");
            EXPECT_NE(run.out.find("crashy [" + pid + "] (corpse)"), std::string::npos) << run.out;
        }
        expectCorpseReport(directory.path + "/r.json", "crashy", child.pid(), c.reported);
    }
}

// A kernel setting under /proc/sys, put back as it was on destruction.
// A machine-wide setting changed for one test and put back afterwards:
// by the test when it ends, failed or not, and by a guardian process when
// the test is killed before it could.
struct KernelSetting {
    explicit KernelSetting(const std::string &p) : path(p) { std::getline(std::ifstream(path) >> std::ws, saved); }
    ~KernelSetting() {
        if (changed) {
            EXPECT_TRUE(put(saved)) << "could not restore " << path;
        }
        if (guardian > 0) {
            (void)!::write(guardianPipe, "r", 1);  // restored: the guardian has nothing to do
            close(guardianPipe);
            waitpid(guardian, nullptr, 0);
        }
    }
    bool write(const std::string &value) {
        if (guardian <= 0) startGuardian();
        changed = true;
        return put(value);
    }
    bool put(const std::string &value) const {
        return static_cast<bool>(std::ofstream(path) << value << "\n" << std::flush);
    }
    // Waits for end of file on a pipe only this process holds open: without
    // the "restored" byte first, the test died and the setting is put back.
    void startGuardian() {
        int fds[2];
        if (pipe2(fds, O_CLOEXEC) != 0) return;
        guardian = fork();
        if (guardian == 0) {
            close(fds[1]);
            char byte = 0;
            if (::read(fds[0], &byte, 1) != 1) put(saved);
            _exit(0);
        }
        close(fds[0]);
        guardianPipe = fds[1];
    }
    std::string path, saved;
    bool changed = false;
    pid_t guardian = -1;
    int guardianPipe = -1;
};

TEST(CorpseRun, CrashRoutedThroughCorePatternIsReported) {
    if (geteuid() != 0) GTEST_SKIP() << "installing a crash helper needs root";
    if (std::getenv("VESTAGE_TEST_KEEP_SYSTEM_SETTINGS") != nullptr) {
        GTEST_SKIP() << "VESTAGE_TEST_KEEP_SYSTEM_SETTINGS is set: core_pattern stays as it is";
    }
    // Since 6.16 the kernel hands a crash helper the crashing task's pidfd (%F).
    utsname name{};
    int major = 0, minor = 0;
    uname(&name);
    if (std::sscanf(name.release, "%d.%d", &major, &minor) != 2 || major * 1000 + minor < 6016) {
        GTEST_SKIP() << "kernel " << name.release;
    }
    ScratchDir directory;
    // The kernel keeps 127 bytes of core_pattern: a short link to the program.
    const std::string helper = directory.path + "/v";
    ASSERT_EQ(symlink(VESTAGE_TEST_BIN_DIR "/vestage", helper.c_str()), 0) << std::strerror(errno);
    const std::string line = "|" + helper +
                             " --corpsePid %P --corpseName %e --corpseDirtyFlags 0 --corpseProcFlags 4 -j " +
                             directory.path + "/%P.json -x %F";
    ASSERT_LT(line.size(), 128u) << line;
    Crasher crasher("crash");
    ASSERT_TRUE(crasher.ready());
    int status = -1;
    {
        // The kernel waits for the helper only with a pipe limit; until the
        // helper has gone the dying process stays readable.
        KernelSetting pattern("/proc/sys/kernel/core_pattern"), pipeLimit("/proc/sys/kernel/core_pipe_limit");
        if (pattern.saved.empty() || pipeLimit.saved.empty()) GTEST_SKIP() << "core_pattern cannot be read here";
        ASSERT_TRUE(pipeLimit.write("4"));
        ASSERT_TRUE(pattern.write(line));
        status = crasher.sendAndReap("now\n");
    }
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGSEGV) << "status " << status;
    expectCorpseReport(directory.path + "/" + std::to_string(crasher.pid()) + ".json", "vs_crasher", crasher.pid());
}

}  // namespace
