#pragma once

// Starting programs from tests: the built vestage (whole runs compared with
// golden output) and vs_memchild, a child whose memory the test arranges.

#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <map>
#include <sstream>
#include <string>
#include <vector>

extern char **environ;

namespace vs::test {

struct RunResult {
    std::string out;
    std::string err;
    int status = -1;
};

struct RunSettings {
    // SIGINT blocked in the child's initial mask, so a SIGINT sent at once
    // stays pending until the program itself waits for it.
    bool blockInterrupt = false;
    // Sent to the child right after it started.
    int signalAfterStart = 0;
    std::string workingDirectory;
};

// Runs the built program with argv[0] "vestage" (the option parser's own
// diagnostics name it) in the C locale, and collects both streams.
inline RunResult runProgram(const std::vector<std::string> &args, const RunSettings &settings = {},
                            const std::string &path = VESTAGE_TEST_BIN_DIR "/vestage") {
    std::vector<std::string> argStorage{"vestage"};
    argStorage.insert(argStorage.end(), args.begin(), args.end());
    std::vector<char *> argv;
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
    if (!settings.workingDirectory.empty()) {
        posix_spawn_file_actions_addchdir_np(&actions, settings.workingDirectory.c_str());
    }
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    sigset_t mask;
    sigemptyset(&mask);
    if (settings.blockInterrupt) sigaddset(&mask, SIGINT);
    posix_spawnattr_setsigmask(&attributes, &mask);
    sigset_t defaults;
    sigemptyset(&defaults);
    sigaddset(&defaults, SIGINT);
    posix_spawnattr_setsigdefault(&attributes, &defaults);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);

    pid_t child = -1;
    int spawnError = posix_spawn(&child, path.c_str(), &actions, &attributes, argv.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    close(outPipe[1]);
    close(errPipe[1]);

    RunResult result;
    if (spawnError != 0) {
        ADD_FAILURE() << "cannot start " << path << ": " << std::strerror(spawnError);
        close(outPipe[0]);
        close(errPipe[0]);
        return result;
    }
    if (settings.signalAfterStart != 0) kill(child, settings.signalAfterStart);

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

// A running vs_memchild holding the memory its items arranged. Each item
// prints "LABEL key=value ..."; the child waits for end of file on its
// standard input once it printed "ready", and is reaped on destruction.
class MemChild {
public:
    explicit MemChild(const std::vector<std::string> &items) {
        int in[2], out[2];
        if (pipe(in) != 0 || pipe(out) != 0) return;
        _pid = fork();
        if (_pid == 0) {
            dup2(in[0], 0);
            dup2(out[1], 1);
            for (int fd : {in[0], in[1], out[0], out[1]}) close(fd);
            std::vector<std::string> storage{VESTAGE_TEST_BIN_DIR "/vs_memchild"};
            storage.insert(storage.end(), items.begin(), items.end());
            std::vector<char *> argv;
            for (auto &s : storage) argv.push_back(s.data());
            argv.push_back(nullptr);
            execv(argv[0], argv.data());
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        _stdin = in[1];
        FILE *reader = fdopen(out[0], "r");
        char line[4096];
        while (reader && std::fgets(line, sizeof line, reader)) {
            std::string text(line);
            if (!text.empty() && text.back() == '\n') text.pop_back();
            if (text == "ready") {
                _ready = true;
                break;
            }
            std::istringstream words(text);
            std::string label, pair;
            words >> label;
            while (words >> pair) {
                size_t eq = pair.find('=');
                if (eq != std::string::npos) _facts[label][pair.substr(0, eq)] = pair.substr(eq + 1);
            }
        }
        if (reader) std::fclose(reader);
    }
    ~MemChild() {
        if (_stdin >= 0) close(_stdin);
        if (_pid > 0) {
            int status = 0;
            waitpid(_pid, &status, 0);
        }
    }
    MemChild(const MemChild &) = delete;
    MemChild &operator=(const MemChild &) = delete;

    bool ready() const { return _ready; }
    pid_t pid() const { return _pid; }
    // The value printed for an item's key, or "" when there was none.
    std::string fact(const std::string &label, const std::string &key) const {
        auto item = _facts.find(label);
        if (item == _facts.end()) return {};
        auto value = item->second.find(key);
        return value == item->second.end() ? std::string() : value->second;
    }

private:
    pid_t _pid = -1;
    int _stdin = -1;
    bool _ready = false;
    std::map<std::string, std::map<std::string, std::string>> _facts;
};

}  // namespace vs::test
