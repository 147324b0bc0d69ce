#pragma once

// Starting programs from tests: whole runs of the built vestage, and
// vs_memchild, a child whose memory the test arranges.

#include <gtest/gtest.h>
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace vs::test {

struct RunResult {
    std::string out, err;
    int status = -1;  // the exit status, or 128 + the signal
    pid_t pid = -1;   // the program's, for what it must say or leave out about itself
};

struct RunSettings {
    bool blockInterrupt = false;  // at the start, so that a SIGINT sent then stays pending
    int signalAfterStart = 0;
    std::string workingDirectory = "";
    // As a kernel crash helper finds things: a descriptor handed over as
    // descriptor 3 (-1: descriptor 3 closed), standard streams closed.
    std::optional<int> descriptor3 = std::nullopt;
    bool closeOutputs = false, closeInput = false;
    uid_t user = 0;  // run as this user (and its own group) when not 0
    std::string standardOutput = "";  // a file to write standard output to, instead of the result
    std::optional<rlim_t> fileLimit = std::nullopt;  // RLIMIT_NOFILE, soft and hard
};

// Drops to an unprivileged user for the rest of a forked child's life.
inline bool becomeUser(uid_t user) {
    return user == 0 || (setgroups(0, nullptr) == 0 && setgid(user) == 0 && setuid(user) == 0);
}

// Runs a program (the built vestage by default) with argv[0] "vestage", named
// by the option parser's diagnostics, in the C locale, on /dev/null.
inline RunResult runProgram(const std::vector<std::string> &args, const RunSettings &s = {},
                            const std::string &path = VESTAGE_TEST_BIN_DIR "/vestage") {
    std::vector<std::string> words{"vestage"};
    words.insert(words.end(), args.begin(), args.end());
    std::vector<char *> argv;
    for (auto &word : words) argv.push_back(word.data());
    argv.push_back(nullptr);
    // Output goes to unnamed files, read once the child is gone.
    const int out = open("/tmp", O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
    const int err = open("/tmp", O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
    const int devNull = open("/dev/null", O_RDONLY | O_CLOEXEC);
    // Blocked from the fork on, so that a SIGINT sent at once stays pending.
    sigset_t interrupt, previous;
    sigemptyset(&interrupt);
    sigaddset(&interrupt, SIGINT);
    pthread_sigmask(SIG_BLOCK, &interrupt, &previous);
    const pid_t child = fork();
    if (child == 0) {
        // Standard streams first: a file may sit on descriptor 3 until then.
        s.closeInput ? close(0) : dup2(devNull, 0);
        if (!s.standardOutput.empty()) {
            const int file = open(s.standardOutput.c_str(), O_WRONLY | O_CLOEXEC);
            dup2(file, 1);
        } else {
            s.closeOutputs ? close(1) : dup2(out, 1);
        }
        s.closeOutputs ? close(2) : dup2(err, 2);
        if (s.descriptor3 && *s.descriptor3 < 0) {
            close(3);
        } else if (s.descriptor3) {
            // dup2 onto itself would keep close-on-exec.
            *s.descriptor3 == 3 ? fcntl(3, F_SETFD, 0) : dup2(*s.descriptor3, 3);
        }
        if (s.fileLimit) {
            const rlimit files{*s.fileLimit, *s.fileLimit};
            if (setrlimit(RLIMIT_NOFILE, &files) != 0) _exit(126);
        }
        signal(SIGINT, SIG_DFL);
        if (!s.blockInterrupt) sigemptyset(&interrupt);
        sigprocmask(SIG_SETMASK, &interrupt, nullptr);
        // Nothing in the environment may change option parsing or its language.
        setenv("LC_ALL", "C", 1);
        unsetenv("POSIXLY_CORRECT");
        if (becomeUser(s.user) && (s.workingDirectory.empty() || chdir(s.workingDirectory.c_str()) == 0)) {
            execv(path.c_str(), argv.data());
        }
        _exit(127);
    }
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    if (s.signalAfterStart != 0) kill(child, s.signalAfterStart);
    RunResult result;
    result.pid = child;
    waitpid(child, &result.status, 0);
    result.status = WIFEXITED(result.status) ? WEXITSTATUS(result.status) : 128 + WTERMSIG(result.status);
    for (auto [fd, text] : {std::pair{out, &result.out}, std::pair{err, &result.err}}) {
        char buffer[4096];
        for (ssize_t n, at = 0; (n = pread(fd, buffer, sizeof buffer, at)) > 0; at += n) text->append(buffer, n);
        close(fd);
    }
    close(devNull);
    return result;
}

// A fresh directory under /tmp with a short name (a crash helper's command
// line has little room), removed with everything in it.
struct ScratchDir {
    ScratchDir() {
        char pattern[] = "/tmp/vsXXXXXX";
        path = mkdtemp(pattern) != nullptr ? pattern : "/nonexistent";
    }
    ~ScratchDir() { std::filesystem::remove_all(path); }
    std::string path;
};

// A running vs_memchild (or another helper) holding the memory its items
// arranged; each printed "LABEL key=value ...". Once it printed "ready" it
// waits for end of file on standard input: given on destruction, then reaped.
class MemChild {
public:
    explicit MemChild(const std::vector<std::string> &items,
                      const std::string &program = VESTAGE_TEST_BIN_DIR "/vs_memchild", uid_t user = 0) {
        std::vector<std::string> words{program};
        words.insert(words.end(), items.begin(), items.end());
        std::vector<char *> argv;
        for (auto &word : words) argv.push_back(word.data());
        argv.push_back(nullptr);
        int in[2], out[2];
        if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) return;
        if ((_pid = fork()) == 0) {
            dup2(in[0], 0);
            dup2(out[1], 1);
            if (becomeUser(user)) execv(argv[0], argv.data());
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        _stdin = in[1];
        char buffer[4096];
        for (ssize_t n; !ready() && (n = read(out[0], buffer, sizeof buffer)) > 0;) _lines.append(buffer, n);
        close(out[0]);
    }
    ~MemChild() {
        close(_stdin);
        if (_pid > 0) {
            kill(_pid, SIGCONT);
            waitpid(_pid, nullptr, 0);
        }
    }
    MemChild(const MemChild &) = delete;
    MemChild &operator=(const MemChild &) = delete;

    bool ready() const { return _lines.find("\nready") != std::string::npos; }
    pid_t pid() const { return _pid < 0 ? -_pid : _pid; }
    // The value printed for an item's key, or "" when there was none.
    std::string fact(const std::string &label, const std::string &key) const {
        const size_t line = _lines.find("\n" + label + " ");
        const size_t at = _lines.find(" " + key + "=", line + 1);
        if (line == std::string::npos || at == std::string::npos || at > _lines.find('\n', line + 1)) return {};
        return _lines.substr(at + key.size() + 2, _lines.find_first_of(" \n", at + 1) - at - key.size() - 2);
    }
    // Writes to the child's standard input, then waits for it to end; its wait status.
    int sendAndReap(const std::string &text) {
        int status = -1;
        if (write(_stdin, text.data(), text.size()) > 0 && waitpid(_pid, &status, 0) == _pid) _pid = -_pid;
        return status;
    }

private:
    pid_t _pid = -1;
    int _stdin = -1;
    std::string _lines = "\n";  // what the child printed, after a newline
};

}  // namespace vs::test
