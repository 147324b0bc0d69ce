// Whole runs of the built program as a crash helper: the checks of the
// handed-over arguments and descriptor, a simulated hand-over (a stopped
// child's pidfd on descriptor 3, standard output and error closed), and a
// real crash routed to the program through the kernel's core_pattern.

#include <gtest/gtest.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/run_program.h"


namespace {

using vs::test::RunResult;
using nlohmann::json;

const char *const kCorpseUsage =
    "Usage: vestage --corpsePid pid --corpseName name --corpseDirtyFlags dirtyFlags --corpseProcFlags procFlags\n"
    "\t--corpsePid pid \t\t\t\tpid of the corpse passed to vestage\n"
    "\t--corpseName name \t\t\t\tname of the corpse passed to vestage\n"
    "\t--corpseDirtyFlags dirtyFlags \t\t\tdirty flags of the corpse passed to vestage in hex\n"
    "\t--corpseProcFlags procFlags \t\t\tproc flags of the corpse passed to vestage in hex\n";

const uint64_t kPage = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
constexpr int kCrasherPages = 256;

int openPidfd(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

// How the program is started: what descriptor 3 holds and which standard
// streams are closed, as a kernel crash helper finds them.
struct HandOverSettings {
    int descriptor3 = -1;  // handed over as descriptor 3; -1: descriptor 3 closed
    bool closeOutputs = false;
    bool closeInput = false;
};

// Runs the built program with argv[0] "vestage" in the C locale. Output and
// error are collected unless closed.
RunResult runHandedOver(const std::vector<std::string> &args, const HandOverSettings &settings) {
    std::vector<std::string> argStorage{"vestage"};
    argStorage.insert(argStorage.end(), args.begin(), args.end());
    std::vector<char *> argv;
    for (auto &a : argStorage) argv.push_back(a.data());
    argv.push_back(nullptr);
    std::vector<std::string> envStorage;
    for (char **e = environ; *e; ++e) {
        if (std::strncmp(*e, "LC_", 3) != 0 && std::strncmp(*e, "LANG", 4) != 0) envStorage.emplace_back(*e);
    }
    envStorage.emplace_back("LC_ALL=C");
    std::vector<char *> envp;
    for (auto &e : envStorage) envp.push_back(e.data());
    envp.push_back(nullptr);
    const std::string path = VESTAGE_TEST_BIN_DIR "/vestage";

    int outPipe[2], errPipe[2];
    if (pipe2(outPipe, O_CLOEXEC) != 0 || pipe2(errPipe, O_CLOEXEC) != 0) {
        ADD_FAILURE() << "pipe: " << std::strerror(errno);
        return {};
    }
    const int devNull = open("/dev/null", O_RDONLY | O_CLOEXEC);
    const pid_t child = fork();
    if (child == 0) {
        // Standard streams first: a pipe may sit on descriptor 3 until then.
        if (settings.closeInput) {
            close(0);
        } else {
            dup2(devNull, 0);
        }
        if (settings.closeOutputs) {
            close(1);
            close(2);
        } else {
            dup2(outPipe[1], 1);
            dup2(errPipe[1], 2);
        }
        if (settings.descriptor3 < 0) {
            close(3);
        } else if (settings.descriptor3 != 3) {
            dup2(settings.descriptor3, 3);
        } else {
            fcntl(3, F_SETFD, 0);  // dup2 onto itself would keep close-on-exec
        }
        execve(path.c_str(), argv.data(), envp.data());
        _exit(127);
    }
    close(devNull);
    close(outPipe[1]);
    close(errPipe[1]);

    RunResult result;
    struct pollfd fds[2] = {{outPipe[0], POLLIN, 0}, {errPipe[0], POLLIN, 0}};
    std::string *sinks[2] = {&result.out, &result.err};
    int open = 2;
    while (open > 0 && poll(fds, 2, -1) >= 0) {
        for (int i = 0; i < 2; ++i) {
            if (fds[i].fd < 0 || !(fds[i].revents & (POLLIN | POLLHUP | POLLERR))) continue;
            char buffer[4096];
            const ssize_t n = read(fds[i].fd, buffer, sizeof buffer);
            if (n > 0) {
                sinks[i]->append(buffer, static_cast<size_t>(n));
            } else {
                close(fds[i].fd);
                fds[i].fd = -1;
                --open;
            }
        }
    }
    int status = 0;
    waitpid(child, &status, 0);
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return result;
}

// A vs_crasher child: stopped with its memory written ("stop"), or waiting
// for the word to crash ("crash"). Killed and reaped on destruction.
class Crasher {
public:
    explicit Crasher(const char *mode) {
        int in[2], out[2];
        if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) return;
        const std::string path = VESTAGE_TEST_BIN_DIR "/vs_crasher";
        const std::string pages = std::to_string(kCrasherPages);
        _pid = fork();
        if (_pid == 0) {
            dup2(in[0], 0);
            dup2(out[1], 1);
            execl(path.c_str(), "vs_crasher", pages.c_str(), mode, static_cast<char *>(nullptr));
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        _input = in[1];
        FILE *reader = fdopen(out[0], "r");
        char line[256] = {};
        _ready = reader && std::fgets(line, sizeof line, reader) && std::strncmp(line, "ready ", 6) == 0;
        if (reader) std::fclose(reader);
        if (_ready && std::strcmp(mode, "stop") == 0) {
            int status = 0;
            _ready = waitpid(_pid, &status, WUNTRACED) == _pid && WIFSTOPPED(status);
        }
    }
    ~Crasher() {
        if (_input >= 0) close(_input);
        if (_pid > 0 && !_reaped) {
            kill(_pid, SIGKILL);
            waitpid(_pid, nullptr, 0);
        }
    }
    Crasher(const Crasher &) = delete;
    Crasher &operator=(const Crasher &) = delete;

    bool ready() const { return _ready; }
    pid_t pid() const { return _pid; }
    // Tells a "crash" child to crash and waits until it is gone; returns its
    // wait status.
    int crashAndReap() {
        const ssize_t written = write(_input, "now\n", 4);
        int status = 0;
        if (written == 4 && waitpid(_pid, &status, 0) == _pid) _reaped = true;
        return status;
    }

private:
    pid_t _pid = -1;
    int _input = -1;
    bool _ready = false;
    bool _reaped = false;
};

class TemporaryDirectory {
public:
    TemporaryDirectory() {
        char pattern[] = "/tmp/vsXXXXXX";  // short: the crash helper's command line has little room
        if (mkdtemp(pattern)) _path = pattern;
    }
    ~TemporaryDirectory() {
        std::error_code ignored;
        if (!_path.empty()) std::filesystem::remove_all(_path, ignored);
    }
    const std::string &path() const { return _path; }

private:
    std::string _path;
};

std::optional<json> readJson(const std::string &path) {
    std::ifstream in(path);
    if (!in) return std::nullopt;
    std::stringstream text;
    text << in.rdbuf();
    json document = json::parse(text.str(), nullptr, false);
    if (document.is_discarded()) {
        ADD_FAILURE() << path << " is not one JSON document:\n" << text.str();
        return std::nullopt;
    }
    return document;
}

// Checks a report that holds exactly one process: the corpse.
void expectCorpseReport(const json &report, const std::string &name, pid_t pid) {
    ASSERT_TRUE(report.contains("processes")) << report.dump();
    ASSERT_EQ(report["processes"].size(), 1u) << report.dump();
    const json &process = report["processes"][0];
    EXPECT_EQ(process.value("name", ""), name);
    EXPECT_EQ(process.value("pid", 0), pid);
    // The crasher wrote every page of its memory: at least that much is its
    // own, whatever its libraries add.
    EXPECT_GE(process.value("vestage", uint64_t{0}), kCrasherPages * kPage) << process.dump();
    EXPECT_FALSE(process.contains("errors")) << process.dump();
    EXPECT_FALSE(process.contains("warnings")) << process.dump();
    // A corpse has neither physical vestage nor kernel memory counters.
    EXPECT_FALSE(process.contains("auxiliary")) << process.dump();
    EXPECT_EQ(report.value("errors", json::array()), json::array()) << report.dump();
}

// The run sequence may not create the corpse target yet; the hand-over
// tests say so instead of failing. Probes with a stopped child.
std::optional<std::string> missingCorpseReport() {
    Crasher child("stop");
    if (!child.ready()) return "the crasher child did not start";
    const int pidfd = openPidfd(child.pid());
    if (pidfd < 0) return std::string("pidfd_open: ") + std::strerror(errno);
    TemporaryDirectory directory;
    const std::string jsonPath = directory.path() + "/probe.json";
    const RunResult run = runHandedOver({"--corpsePid", std::to_string(child.pid()), "--corpseName", "probe",
                                         "--corpseProcFlags", "4", "--json", jsonPath},
                                        {pidfd});
    close(pidfd);
    if (run.err.find("Unable to find any processes matching") != std::string::npos) {
        return "the run sequence does not create the corpse target yet";
    }
    return std::nullopt;
}

TEST(CorpseRun, UnusableArgumentsOrDescriptorEndTheRun) {
    Crasher child("stop");
    ASSERT_TRUE(child.ready());
    const std::string pid = std::to_string(child.pid());
    TemporaryDirectory directory;
    ASSERT_FALSE(directory.path().empty());

    // Descriptors that are not a usable pidfd.
    const int regularFile = open((directory.path() + "/not-a-pidfd").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    int pipeEnds[2];
    ASSERT_EQ(pipe2(pipeEnds, O_CLOEXEC), 0);
    pid_t reaped = fork();
    if (reaped == 0) _exit(0);
    const int reapedPidfd = openPidfd(reaped);
    waitpid(reaped, nullptr, 0);
    const int livePidfd = openPidfd(child.pid());
    ASSERT_GE(regularFile, 0);
    ASSERT_GE(reapedPidfd, 0);
    ASSERT_GE(livePidfd, 0);

    const std::string invalid = "Invalid arguments for corpse mode\n";
    const std::string noPort = "Failed to retrieve corpse port\n";
    struct Case {
        const char *what;
        std::vector<std::string> args;
        int descriptor3;
        std::string err;
    };
    const std::vector<std::string> valid = {"--corpsePid", pid, "--corpseName", "crashy"};
    const std::vector<Case> cases = {
        // The arguments are checked before the descriptor is looked at.
        {"pid 0", {"--corpseName", "n", "--corpsePid", "0"}, livePidfd, invalid},
        {"a name alone leaves the pid at -1", {"--corpseName", "x"}, livePidfd, invalid},
        {"no name", {"--corpsePid", pid}, livePidfd, invalid},
        {"a negative pid", {"--corpsePid", "-5", "--corpseName", "n"}, livePidfd, invalid},
        {"a pid that is 0 in 32 bits", {"--corpsePid", "4294967296", "--corpseName", "n"}, livePidfd, invalid},
        {"a pid without digits", {"--corpsePid", "abc", "--corpseName", "n"}, livePidfd, invalid},
        {"nothing on descriptor 3", valid, -1, noPort},
        {"a regular file whose name says pidfd", valid, regularFile, noPort},
        {"a pipe", valid, pipeEnds[0], noPort},
        {"the pidfd of a process already reaped", valid, reapedPidfd, noPort},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        const RunResult run = runHandedOver(c.args, {c.descriptor3});
        EXPECT_EQ(run.err, c.err);
        EXPECT_EQ(run.out, kCorpseUsage);
        EXPECT_EQ(run.status, 1);
    }
    for (int fd : {regularFile, pipeEnds[0], pipeEnds[1], reapedPidfd, livePidfd}) close(fd);
}

TEST(CorpseRun, HandedOverSnapshotIsReportedInTheJsonFile) {
    if (geteuid() != 0) GTEST_SKIP() << "reading another process's memory needs root";
    if (auto missing = missingCorpseReport()) GTEST_SKIP() << *missing;

    struct Case {
        const char *what;
        HandOverSettings settings;
        std::vector<std::string> extraArgs;
        std::string dirtyFlags;
        bool reported;
    };
    const std::vector<Case> cases = {
        {"standard streams open: the text report labels the snapshot", {-1, false, false}, {}, "0", true},
        {"as a crash helper: output and error closed", {-1, true, false}, {}, "0", true},
        {"all three standard streams closed", {-1, true, true}, {}, "0", true},
        // The snapshot is never analysed beside the live process under its pid.
        {"the live process under the same pid asked for too", {-1, true, false}, {"-p", "PID"}, "0", true},
        {"exclusions that leave nothing else", {-1, true, false}, {"-x", "init", "-x", "PID"}, "0", true},
        // Idle-exit state comes from the handed-in flags: clean, so -s drops it.
        {"-s with dirty flags of a clean idle-exit process", {-1, true, false}, {"-s"}, "3", false},
        {"-s with dirty flags of a dirty idle-exit process", {-1, true, false}, {"-s"}, "7", true},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        Crasher child("stop");
        ASSERT_TRUE(child.ready());
        const std::string pid = std::to_string(child.pid());
        const int pidfd = openPidfd(child.pid());
        ASSERT_GE(pidfd, 0) << std::strerror(errno);
        TemporaryDirectory directory;
        const std::string jsonPath = directory.path() + "/report.json";

        std::vector<std::string> args = {"--corpsePid", pid, "--corpseName", "crashy", "--corpseDirtyFlags",
                                         c.dirtyFlags, "--corpseProcFlags", "4", "--json", jsonPath};
        for (const std::string &extra : c.extraArgs) args.push_back(extra == "PID" ? pid : extra);
        HandOverSettings settings = c.settings;
        settings.descriptor3 = pidfd;
        const RunResult run = runHandedOver(args, settings);
        close(pidfd);
        EXPECT_EQ(run.status, 0);
        if (!settings.closeOutputs) {
            EXPECT_EQ(run.err, "");
            EXPECT_NE(run.out.find("crashy [" + pid + "] (corpse)"), std::string::npos) << run.out;
        }

        std::optional<json> report = readJson(jsonPath);
        ASSERT_TRUE(report.has_value()) << "no report at " << jsonPath;
        if (c.reported) {
            expectCorpseReport(*report, "crashy", child.pid());
        } else {
            EXPECT_EQ(report->value("processes", json::array()), json::array()) << report->dump();
        }
    }
}

// ---- a real crash through core_pattern -------------------------------------------------

// A kernel setting under /proc/sys, put back as it was when this object
// dies (or earlier, with restore()).
class SavedKernelSetting {
public:
    explicit SavedKernelSetting(std::string path) : _path(std::move(path)) {
        std::ifstream in(_path);
        std::string value;
        if (in && std::getline(in, value)) _saved = value;
    }
    ~SavedKernelSetting() { restore(); }
    SavedKernelSetting(const SavedKernelSetting &) = delete;
    SavedKernelSetting &operator=(const SavedKernelSetting &) = delete;

    bool readable() const { return _saved.has_value(); }
    bool set(const std::string &value) {
        _changed = true;
        return write(value);
    }
    void restore() {
        if (_changed && _saved) {
            if (!write(*_saved)) ADD_FAILURE() << "could not restore " << _path << " to " << *_saved;
            _changed = false;
        }
    }

private:
    bool write(const std::string &value) const {
        std::ofstream out(_path);
        out << value << "\n";
        out.flush();
        return static_cast<bool>(out);
    }

    std::string _path;
    std::optional<std::string> _saved;
    bool _changed = false;
};

// Since 6.16 the kernel hands a crash helper the crashing task's pidfd
// (core_pattern's %F).
bool kernelHandsOverPidfd(std::string &release) {
    struct utsname name;
    if (uname(&name) != 0) return false;
    release = name.release;
    int major = 0, minor = 0;
    if (std::sscanf(name.release, "%d.%d", &major, &minor) != 2) return false;
    return major > 6 || (major == 6 && minor >= 16);
}

class CrashHelperTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string release;
        if (geteuid() != 0) GTEST_SKIP() << "installing a crash helper needs root";
        if (!kernelHandsOverPidfd(release)) {
            GTEST_SKIP() << "kernel " << release << " does not hand a pidfd to crash helpers (needs 6.16)";
        }
        if (!pattern.readable() || !pipeLimit.readable()) GTEST_SKIP() << "core_pattern cannot be read here";
        if (auto missing = missingCorpseReport()) GTEST_SKIP() << *missing;
    }
    void TearDown() override {
        pattern.restore();
        pipeLimit.restore();
    }

    SavedKernelSetting pattern{"/proc/sys/kernel/core_pattern"};
    SavedKernelSetting pipeLimit{"/proc/sys/kernel/core_pipe_limit"};
};

TEST_F(CrashHelperTest, CrashRoutedThroughCorePatternIsReported) {
    TemporaryDirectory directory;
    ASSERT_FALSE(directory.path().empty());
    // The kernel keeps 127 bytes of core_pattern: a short link to the program.
    const std::string helper = directory.path() + "/v";
    ASSERT_EQ(symlink(VESTAGE_TEST_BIN_DIR "/vestage", helper.c_str()), 0) << std::strerror(errno);
    const std::string line = "|" + helper +
                             " --corpsePid %P --corpseName %e --corpseDirtyFlags 0 --corpseProcFlags 4 -j " +
                             directory.path() + "/%P.json -x %F";
    ASSERT_LT(line.size(), 128u) << line;

    Crasher crasher("crash");
    ASSERT_TRUE(crasher.ready());
    // The kernel waits for the helper only with a pipe limit; until the
    // helper has gone the dying process stays readable.
    ASSERT_TRUE(pipeLimit.set("4"));
    ASSERT_TRUE(pattern.set(line));
    const int status = crasher.crashAndReap();
    pattern.restore();
    pipeLimit.restore();
    ASSERT_TRUE(WIFSIGNALED(status)) << "status " << status;
    EXPECT_EQ(WTERMSIG(status), SIGSEGV);

    const std::string jsonPath = directory.path() + "/" + std::to_string(crasher.pid()) + ".json";
    std::optional<json> report = readJson(jsonPath);
    ASSERT_TRUE(report.has_value()) << "the crash helper left no report at " << jsonPath;
    expectCorpseReport(*report, "vs_crasher", crasher.pid());
}

}  // namespace
