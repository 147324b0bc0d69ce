#pragma once

// Parsers for the small per-process files of /proc: stat, status, syscall
// and the mount table. Pure functions over text, so they are tested on
// recorded samples.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vs {

// The fields of /proc/PID/stat this program reads. The command name sits
// in parentheses and may itself hold ')' and blanks, so the fields after it
// are counted from the last ')' of the line.
struct ProcStat {
    int32_t pid = 0;
    std::string comm;
    char state = '?';
    int32_t ppid = 0;
    uint64_t flags = 0; // PF_* bits
    uint64_t numThreads = 0;
    // Clock ticks after boot when the process started: with the pid, it
    // names one process, since a pid is reused only after its process ended.
    uint64_t startTime = 0;
};

inline constexpr uint64_t kLinuxKernelThreadFlag = 0x00200000; // PF_KTHREAD

std::optional<ProcStat> parseStat(std::string_view text);

// A process that has gone, or is going: a zombie, dead, or exiting
// (PF_EXITING: its address space is being torn down and reads empty).
bool statSaysGone(const ProcStat &stat);

// The text after "Name:" of a status line, blanks trimmed; nullopt when the
// line is missing.
std::optional<std::string_view> statusValue(std::string_view status, std::string_view name);

// A "Name:   123 kB" status line in bytes (a plain number without unit is
// returned as it stands); nullopt when the line is missing.
std::optional<uint64_t> statusBytes(std::string_view status, std::string_view name);

// The stack pointer of a thread from task/TID/syscall: the second-to-last
// field. nullopt while the thread is running on a processor ("running"),
// and for text that does not look like the file.
std::optional<uint64_t> parseSyscallStackPointer(std::string_view text);

// A mounted file system: its device number (major << 32 | minor) and type.
struct MountDevice {
    uint64_t device = 0;
    std::string type;
};

// Every mount listed in a mountinfo text.
std::vector<MountDevice> parseMountDevices(std::string_view mountinfo);

// False for file systems whose files a probe must not open because they
// may not answer: FUSE and network file systems.
bool mayProbeFileSystem(std::string_view type);

// Number of NUL-terminated strings in a cmdline text; a missing final NUL
// (a process that rewrote its arguments) still counts the last string.
uint32_t countArguments(std::string_view cmdline);

} // namespace vs
