#pragma once

// Starts tests/helpers/vs_memchild with arranged memory and reads back what
// it printed: one line per item, "LABEL key=value ...", until "ready". The
// child waits until its standard input is closed, so the test decides when
// it goes away.

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <map>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace vs_test {

class ChildProcess {
public:
    explicit ChildProcess(const std::vector<std::string> &items,
                          const std::string &program = std::string(VESTAGE_TEST_BIN_DIR) + "/vs_memchild") {
        int in[2];
        int out[2];
        if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) {
            return;
        }
        _pid = fork();
        if (_pid == 0) {
            dup2(in[0], STDIN_FILENO);
            dup2(out[1], STDOUT_FILENO);
            std::vector<char *> argv;
            argv.push_back(const_cast<char *>(program.c_str()));
            for (const std::string &item : items) {
                argv.push_back(const_cast<char *>(item.c_str()));
            }
            argv.push_back(nullptr);
            execv(program.c_str(), argv.data());
            _exit(127);
        }
        close(in[0]);
        close(out[1]);
        _stdin = in[1];
        FILE *output = fdopen(out[0], "r");
        char line[4096];
        while (output != nullptr && fgets(line, sizeof line, output) != nullptr) {
            std::string text(line);
            while (!text.empty() && text.back() == '\n') {
                text.pop_back();
            }
            if (text == "ready") {
                _ready = true;
                break;
            }
            _parse(text);
        }
        if (output != nullptr) {
            fclose(output);
        }
    }

    ChildProcess(const ChildProcess &) = delete;
    ChildProcess &operator=(const ChildProcess &) = delete;

    ~ChildProcess() {
        if (_pid > 0 && !_reaped) {
            end();
        }
    }

    bool ready() const { return _ready; }
    int pid() const { return _pid; }

    // The raw value of key in the line of label; empty when missing.
    std::string text(const std::string &label, const std::string &key) const {
        auto line = _lines.find(label);
        if (line == _lines.end()) {
            return {};
        }
        auto value = line->second.find(key);
        return value == line->second.end() ? std::string() : value->second.front();
    }
    // All values of a key that occurs several times in one line.
    std::vector<std::string> texts(const std::string &label, const std::string &key) const {
        auto line = _lines.find(label);
        if (line == _lines.end() || line->second.count(key) == 0) {
            return {};
        }
        return line->second.at(key);
    }
    uint64_t hex(const std::string &label, const std::string &key) const {
        return std::strtoull(text(label, key).c_str(), nullptr, 16);
    }
    int64_t decimal(const std::string &label, const std::string &key) const {
        return std::strtoll(text(label, key).c_str(), nullptr, 10);
    }

    // Closes its input: the child (and any grandchild) finishes and is reaped.
    int end() {
        if (_stdin >= 0) {
            close(_stdin);
            _stdin = -1;
        }
        return _reap();
    }

    // Kills the child; with reap false it stays a zombie until reaped.
    void kill(bool reap) {
        ::kill(_pid, SIGKILL);
        if (reap) {
            _reap();
        }
    }

    // Waits until the child has become a zombie (without reaping it).
    void waitUntilZombie() const {
        siginfo_t info{};
        waitid(P_PID, static_cast<id_t>(_pid), &info, WEXITED | WNOWAIT);
    }

    int reap() { return _reap(); }

private:
    void _parse(const std::string &line) {
        const size_t blank = line.find(' ');
        const std::string label = line.substr(0, blank);
        auto &values = _lines[label];
        size_t pos = blank;
        while (pos != std::string::npos) {
            const size_t start = pos + 1;
            pos = line.find(' ', start);
            const std::string pair = line.substr(start, pos == std::string::npos ? std::string::npos : pos - start);
            const size_t equals = pair.find('=');
            if (equals != std::string::npos) {
                values[pair.substr(0, equals)].push_back(pair.substr(equals + 1));
            }
        }
    }

    int _reap() {
        if (_reaped || _pid <= 0) {
            return -1;
        }
        if (_stdin >= 0) {
            close(_stdin);
            _stdin = -1;
        }
        int status = 0;
        while (waitpid(_pid, &status, 0) < 0 && errno == EINTR) {
        }
        _reaped = true;
        return status;
    }

    int _pid = -1;
    int _stdin = -1;
    bool _ready = false;
    bool _reaped = false;
    std::map<std::string, std::map<std::string, std::vector<std::string>>> _lines;
};

} // namespace vs_test
