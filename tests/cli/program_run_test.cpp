// Whole runs of the built program: stdout, stderr and exit status compared
// byte for byte. argv[0] is fixed to "vestage" because the option parser's
// own diagnostics name it; the locale is fixed so they are not translated.

#include <gtest/gtest.h>
#include <poll.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

extern char **environ;

namespace {

const char *const kUsage =
    "Gather memory information about a process or set of processes\n"
    "Usage: vestage [args] [proc/pid/heapfile [proc/pid/heapfile [...]]]\n"
    "\t-a, --all \t\t\t\ttarget all processes\n"
    "\t-j, --json <file> \t\t\tprint json output to a file\n"
    "\t-h, --help \t\t\t\tprint this output\n"
    "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)\n"
    "\t-x, --exclude [proc/pid] \t\texclude pid or process\n"
    "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean\n"
    "\t-v \t\t\t\t\tspanlist-like output of address space layout\n"
    "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)\n"
    "\t-y, --summary\t\t\t\tprint only dirty regions, and always exclude __TEXT, __DATA and __LINKEDIT "
    "regions\n"
    "\t-w, --wide\t\t\t\tshow wide output with all columns (implies --swapped --wired)\n"
    "\t--swapped\t\t\t\tshow swapped/compressed column\n"
    "\t--wired\t\t\t\t\tshow wired column\n";

const char *const kNothingToAnalyse = "Must specify at least one process or heapfile\n";
const char *const kBadFormat =
    "Unrecognized argument to -f / --format.\n\nAccepted arguments: 'bytes', 'formatted', 'pages'.\n";

std::string badPid(const std::string &text) {
    return "'" + text +
           "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process "
           "name.\n";
}

struct RunResult {
    std::string out;
    std::string err;
    int status = -1;
};

RunResult runProgram(const std::vector<std::string> &args) {
    std::string path = VESTAGE_TEST_BIN_DIR "/vestage";
    std::vector<char *> argv;
    std::string name = "vestage";
    argv.push_back(name.data());
    std::vector<std::string> argStorage(args);
    for (auto &a : argStorage) argv.push_back(a.data());
    argv.push_back(nullptr);

    // Same environment, minus anything that changes option parsing or its language.
    std::vector<std::string> envStorage;
    for (char **e = environ; *e; ++e) {
        if (std::strncmp(*e, "POSIXLY_CORRECT=", 16) != 0 && std::strncmp(*e, "LC_", 3) != 0 &&
            std::strncmp(*e, "LANG", 4) != 0) {
            envStorage.emplace_back(*e);
        }
    }
    envStorage.emplace_back("LC_ALL=C");
    std::vector<char *> envp;
    for (auto &e : envStorage) envp.push_back(e.data());
    envp.push_back(nullptr);

    int outPipe[2], errPipe[2];
    EXPECT_EQ(pipe(outPipe), 0);
    EXPECT_EQ(pipe(errPipe), 0);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, outPipe[1], 1);
    posix_spawn_file_actions_adddup2(&actions, errPipe[1], 2);
    for (int fd : {outPipe[0], outPipe[1], errPipe[0], errPipe[1]}) {
        posix_spawn_file_actions_addclose(&actions, fd);
    }
    pid_t child = -1;
    int spawnError = posix_spawn(&child, path.c_str(), &actions, nullptr, argv.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    close(outPipe[1]);
    close(errPipe[1]);

    RunResult result;
    if (spawnError != 0) {
        ADD_FAILURE() << "cannot start " << path << ": " << std::strerror(spawnError);
        close(outPipe[0]);
        close(errPipe[0]);
        return result;
    }
    // Drain both pipes together so a chatty child cannot block on a full one.
    struct pollfd fds[2] = {{outPipe[0], POLLIN, 0}, {errPipe[0], POLLIN, 0}};
    std::string *sinks[2] = {&result.out, &result.err};
    int open = 2;
    while (open > 0) {
        if (poll(fds, 2, -1) < 0) break;
        for (int i = 0; i < 2; ++i) {
            if (fds[i].fd < 0 || !(fds[i].revents & (POLLIN | POLLHUP | POLLERR))) continue;
            char buffer[4096];
            ssize_t n = read(fds[i].fd, buffer, sizeof buffer);
            if (n > 0) {
                sinks[i]->append(buffer, static_cast<size_t>(n));
            } else {
                close(fds[i].fd);
                fds[i].fd = -1;
                --open;
            }
        }
    }
    int waitStatus = 0;
    waitpid(child, &waitStatus, 0);
    result.status = WIFEXITED(waitStatus) ? WEXITSTATUS(waitStatus) : 128 + WTERMSIG(waitStatus);
    return result;
}

struct ProgramCase {
    std::vector<std::string> args;
    std::string out;
    std::string err;
    int status;
};

TEST(ProgramRun, OptionScanOutcomes) {
    const std::string usage = kUsage;
    const ProgramCase cases[] = {
        // Help wins only if it is reached.
        {{"-h"}, usage, "", 0},
        {{"--help"}, usage, "", 0},
        {{"--he"}, usage, "", 0},
        {{"-vh", "--bogus"}, usage, "", 0},
        {{"-h", "-f", "Formatted"}, usage, "", 0},
        {{"-f", "Formatted", "-h"}, "", kBadFormat, 1},
        {{"--format=Bytes"}, "", kBadFormat, 1},
        {{"-f", ""}, "", kBadFormat, 1},
        {{"-f", "pagesx"}, "", kBadFormat, 1},

        // --pid wants at least one digit; -p would take a name.
        {{"--pid", "abc"}, "", badPid("abc"), 1},
        {{"--pid", ""}, "", badPid(""), 1},
        {{"--pid", " "}, "", badPid(" "), 1},
        {{"--pid=-"}, "", badPid("-"), 1},
        {{"--pid", "7", "--pid", "x7"}, "", badPid("x7"), 1},

        // The option parser's diagnostics come first, then the usage text.
        {{"--v"}, usage, "vestage: unrecognized option '--v'\n", 1},
        {{"--corpse", "x"},
         usage,
         "vestage: option '--corpse' is ambiguous; possibilities: '--corpsePid' '--corpseName' "
         "'--corpseDirtyFlags' '--corpseProcFlags'\n",
         1},
        {{"--s"}, usage, "vestage: option '--s' is ambiguous; possibilities: '--skip' '--summary' '--swapped'\n", 1},
        {{"-b"}, usage, "vestage: invalid option -- 'b'\n", 1},
        {{"-j"}, usage, "vestage: option requires an argument -- 'j'\n", 1},
        {{"-v", "-f"}, usage, "vestage: option requires an argument -- 'f'\n", 1},
        {{"--json"}, usage, "vestage: option '--json' requires an argument\n", 1},
        {{"--all=yes"}, usage, "vestage: option '--all' doesn't allow an argument\n", 1},
        {{"--skip=1"}, usage, "vestage: option '--skip' doesn't allow an argument\n", 1},
        {{"--pid"}, usage, "vestage: option '--pid' requires an argument\n", 1},

        // Accepted options that name no target: the run stops before any gathering.
        {{}, usage, kNothingToAnalyse, 1},
        {{"-v", "-f", "pages", "-f", "bytes"}, usage, kNothingToAnalyse, 1},
        {{"-w", "--swapped", "--wired", "--sum", "--targetC", "-s"}, usage, kNothingToAnalyse, 1},
        {{"--json=out.json", "--physVestage"}, usage, kNothingToAnalyse, 1},
        {{"-x", "1", "--exclude", "init"}, usage, kNothingToAnalyse, 1},
        {{"--"}, usage, kNothingToAnalyse, 1},
    };
    for (const ProgramCase &c : cases) {
        std::string label = "vestage";
        for (const auto &a : c.args) label += " '" + a + "'";
        SCOPED_TRACE(label);
        RunResult r = runProgram(c.args);
        EXPECT_EQ(r.out, c.out);
        EXPECT_EQ(r.err, c.err);
        EXPECT_EQ(r.status, c.status);
    }
}

}  // namespace
