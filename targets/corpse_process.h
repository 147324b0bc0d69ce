#pragma once

// A crashing process handed over by the system: its address space is still
// readable through a task handle the launcher gave this program, but the
// process no longer runs. It is walked and classified exactly like a live
// process; everything that needs a running process is left out:
//
// - no live state is asked for: no physical vestage, no "Kernel memory"
//   counters (so its auxData is null), no paths of mapped files;
// - its pid, name, pointer width and idle-exit state come from the launcher,
//   not from the process table, which may already hold another process
//   under that pid;
// - a failing region or page query is an error, never excused as the
//   process having exited: its memory was expected to stay readable.
//
// The task handle is not opened by the target and is not given back by it;
// it belongs to this program's own task.

#include <cstdint>
#include <memory>
#include <string>

#include "targets/user_process.h"

class VSCorpseProcess : public VSUserProcess {
public:
    VSCorpseProcess() = default;

    // The target for the corpse whose task handle is `port`, labelled
    // "name [pid] (corpse)". `dirtyFlags` are the process's dirty-tracking
    // flags, `procFlags` its process flags (only the low 32 bits of both
    // are meaningful). Null when the target cannot be made (no handle).
    static std::unique_ptr<VSProcess> processWithCorpse(uint32_t port, int32_t pid, const std::string &name,
                                                        uint64_t dirtyFlags, uint64_t procFlags);

    // The BSD info record flags for a corpse's process flags: 64-bit
    // process, system process and four more bits are carried over, every
    // other bit is dropped.
    static uint32_t bsdInfoFlagsForProcFlags(uint32_t procFlags);

    bool _isAlive() const override { return false; }

protected:
    bool initWithCorpse(uint32_t port, int32_t pid, const std::string &name, uint32_t dirtyFlags,
                        uint32_t procFlags);
    // The handle was handed in; nothing is opened.
    bool _populateTask() override;
    // The state comes from the handed-in flags; the pid may by now belong to
    // another process, or to none.
    void _gatherIdleExitStatus() override {}
};
