#include "targets/platform/linux/proc_text.h"

namespace vs {

namespace {

bool readDecimal(std::string_view s, size_t &pos, uint64_t &value) {
    const size_t first = pos;
    uint64_t v = 0;
    while (pos < s.size() && s[pos] >= '0' && s[pos] <= '9') {
        v = v * 10 + static_cast<uint64_t>(s[pos] - '0');
        ++pos;
    }
    value = v;
    return pos != first;
}

bool readSigned(std::string_view s, size_t &pos, int64_t &value) {
    bool negative = false;
    if (pos < s.size() && s[pos] == '-') {
        negative = true;
        ++pos;
    }
    uint64_t magnitude = 0;
    if (!readDecimal(s, pos, magnitude)) {
        return false;
    }
    // A number out of range is no field of the kernel's: refused, also
    // because negating it as a signed value would overflow.
    if (magnitude > (negative ? uint64_t{1} << 63 : uint64_t{INT64_MAX})) {
        return false;
    }
    value = static_cast<int64_t>(negative ? 0 - magnitude : magnitude);
    return true;
}

void skipBlanks(std::string_view s, size_t &pos) {
    while (pos < s.size() && (s[pos] == ' ' || s[pos] == '\t')) {
        ++pos;
    }
}

// Moves past one blank-separated field.
void skipField(std::string_view s, size_t &pos) {
    skipBlanks(s, pos);
    while (pos < s.size() && s[pos] != ' ' && s[pos] != '\n') {
        ++pos;
    }
}

std::string_view trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) {
        s.remove_prefix(1);
    }
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\n')) {
        s.remove_suffix(1);
    }
    return s;
}

} // namespace

std::optional<ProcStat> parseStat(std::string_view text) {
    const size_t open = text.find('(');
    const size_t close = text.rfind(')');
    if (open == std::string_view::npos || close == std::string_view::npos || close < open) {
        return std::nullopt;
    }
    ProcStat st;
    size_t pos = 0;
    int64_t pid = 0;
    if (!readSigned(text, pos, pid)) {
        return std::nullopt;
    }
    st.pid = static_cast<int32_t>(pid);
    st.comm.assign(text.substr(open + 1, close - open - 1));

    // Fields from 3 on: state ppid pgrp session tty_nr tpgid flags ...
    pos = close + 1;
    skipBlanks(text, pos);
    if (pos >= text.size()) {
        return std::nullopt;
    }
    st.state = text[pos++];
    skipBlanks(text, pos);
    int64_t ppid = 0;
    if (!readSigned(text, pos, ppid)) {
        return std::nullopt;
    }
    st.ppid = static_cast<int32_t>(ppid);
    for (int field = 5; field < 9; ++field) { // pgrp session tty_nr tpgid
        skipField(text, pos);
    }
    skipBlanks(text, pos);
    if (!readDecimal(text, pos, st.flags)) {
        return std::nullopt;
    }
    // num_threads is field 20.
    for (int field = 10; field < 20; ++field) {
        skipField(text, pos);
    }
    skipBlanks(text, pos);
    readDecimal(text, pos, st.numThreads);
    skipField(text, pos); // itrealvalue
    skipBlanks(text, pos);
    readDecimal(text, pos, st.startTime); // field 22
    return st;
}

bool statSaysGone(const ProcStat &stat) {
    constexpr uint64_t kExitingFlag = 0x4; // PF_EXITING
    return stat.state == 'Z' || stat.state == 'X' || (stat.flags & kExitingFlag) != 0;
}

std::optional<std::string_view> statusValue(std::string_view status, std::string_view name) {
    size_t pos = 0;
    while (pos < status.size()) {
        size_t newline = status.find('\n', pos);
        if (newline == std::string_view::npos) {
            newline = status.size();
        }
        const std::string_view line = status.substr(pos, newline - pos);
        pos = newline + 1;
        if (line.size() > name.size() && line[0] == name[0] && line[name.size()] == ':' &&
            line.compare(0, name.size(), name) == 0) {
            return trim(line.substr(name.size() + 1));
        }
    }
    return std::nullopt;
}

std::optional<uint64_t> statusBytes(std::string_view status, std::string_view name) {
    const auto value = statusValue(status, name);
    if (!value) {
        return std::nullopt;
    }
    size_t pos = 0;
    uint64_t number = 0;
    if (!readDecimal(*value, pos, number)) {
        return std::nullopt;
    }
    skipBlanks(*value, pos);
    if (value->substr(pos) == "kB") {
        number *= 1024;
    }
    return number;
}

std::optional<uint64_t> parseSyscallStackPointer(std::string_view text) {
    text = trim(text);
    if (text.empty() || text == "running") {
        return std::nullopt;
    }
    // The last two fields are the stack pointer and the program counter.
    const size_t lastBlank = text.rfind(' ');
    if (lastBlank == std::string_view::npos || lastBlank == 0) {
        return std::nullopt;
    }
    const size_t previousBlank = text.rfind(' ', lastBlank - 1);
    const size_t first = previousBlank == std::string_view::npos ? 0 : previousBlank + 1;
    std::string_view field = text.substr(first, lastBlank - first);
    if (field.size() > 2 && field[0] == '0' && field[1] == 'x') {
        field.remove_prefix(2);
    } else {
        return std::nullopt;
    }
    uint64_t value = 0;
    for (char c : field) {
        int digit;
        if (c >= '0' && c <= '9') {
            digit = c - '0';
        } else if (c >= 'a' && c <= 'f') {
            digit = c - 'a' + 10;
        } else {
            return std::nullopt;
        }
        value = (value << 4) | static_cast<uint64_t>(digit);
    }
    return value;
}

std::vector<MountDevice> parseMountDevices(std::string_view mountinfo) {
    // 36 35 0:22 / /dev/shm rw,nosuid shared:3 - tmpfs tmpfs rw
    std::vector<MountDevice> devices;
    size_t pos = 0;
    while (pos < mountinfo.size()) {
        size_t newline = mountinfo.find('\n', pos);
        if (newline == std::string_view::npos) {
            newline = mountinfo.size();
        }
        const std::string_view line = mountinfo.substr(pos, newline - pos);
        pos = newline + 1;
        const size_t separator = line.find(" - ");
        if (separator == std::string_view::npos) {
            continue;
        }
        std::string_view type = line.substr(separator + 3);
        type = type.substr(0, type.find(' '));
        size_t p = 0;
        skipField(line, p); // mount id
        skipField(line, p); // parent id
        skipBlanks(line, p);
        uint64_t major = 0;
        uint64_t minor = 0;
        if (type.empty() || !readDecimal(line, p, major) || p >= line.size() || line[p] != ':') {
            continue;
        }
        ++p;
        if (!readDecimal(line, p, minor)) {
            continue;
        }
        devices.push_back(MountDevice{(major << 32) | minor, std::string(type)});
    }
    return devices;
}

bool mayProbeFileSystem(std::string_view type) {
    // FUSE servers and network file systems can take any time to answer,
    // or never answer: files on them are never opened for a probe.
    if (type == "fuse" || type == "fuseblk" || type.substr(0, 5) == "fuse." || type == "virtiofs") {
        return false;
    }
    static constexpr std::string_view kNetwork[] = {
        "nfs", "nfs4", "cifs", "smb3", "smbfs", "9p", "ceph", "afs", "glusterfs", "lustre",
        "ocfs2", "gfs2", "coda", "ncpfs", "orangefs", "pvfs2", "beegfs", "gpfs", "davfs",
    };
    for (std::string_view network : kNetwork) {
        if (type == network) {
            return false;
        }
    }
    return true;
}

uint32_t countArguments(std::string_view cmdline) {
    uint32_t count = 0;
    for (char c : cmdline) {
        if (c == '\0') {
            ++count;
        }
    }
    if (!cmdline.empty() && cmdline.back() != '\0') {
        ++count;
    }
    return count;
}

} // namespace vs
