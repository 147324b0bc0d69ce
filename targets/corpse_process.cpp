#include "targets/corpse_process.h"

#include <string>

namespace {

// Process flag bits of the launcher and the BSD info record bits they become.
struct FlagMapping {
    uint32_t procFlag;
    uint32_t recordFlag;
};

constexpr FlagMapping kFlagMappings[] = {
    {0x4, vs::kBsdInfoFlag64Bit},
    {0x200, vs::kBsdInfoFlagSystem},
    {0x2, 0x80},
    {0x1000000, 0x100},
    {0x100, 0x2000},
    {0x4000, 0x4000},
};

}  // namespace

uint32_t VSCorpseProcess::bsdInfoFlagsForProcFlags(uint32_t procFlags) {
    uint32_t flags = 0;
    for (const FlagMapping &mapping : kFlagMappings) {
        if ((procFlags & mapping.procFlag) != 0) {
            flags |= mapping.recordFlag;
        }
    }
    return flags;
}

std::unique_ptr<VSProcess> VSCorpseProcess::processWithCorpse(uint32_t port, int32_t pid, const std::string &name,
                                                              uint64_t dirtyFlags, uint64_t procFlags) {
    auto corpse = std::make_unique<VSCorpseProcess>();
    if (!corpse->initWithCorpse(port, pid, name, static_cast<uint32_t>(dirtyFlags),
                                static_cast<uint32_t>(procFlags))) {
        return nullptr;
    }
    return corpse;
}

bool VSCorpseProcess::initWithCorpse(uint32_t port, int32_t pid, const std::string &name, uint32_t dirtyFlags,
                                     uint32_t procFlags) {
    // Stored first: the set-up below asks _populateTask for it.
    _task = port;

    VSBsdInfo info;
    info.flags = bsdInfoFlagsForProcFlags(procFlags);
    info.pid = static_cast<uint32_t>(pid);
    if (!VSUserProcess::initWithBsdInfo(info)) {
        return false;
    }
    // Whatever the process table says about this pid now, the launcher's
    // name is the crashed process's.
    setName(name);
    setDisplayString(name + " [" + std::to_string(pid) + "] (corpse)");
    _setIdleExitStatusFromDirtyFlags(dirtyFlags);
    return true;
}

bool VSCorpseProcess::_populateTask() { return _task != vs::kTaskHandleNone; }
