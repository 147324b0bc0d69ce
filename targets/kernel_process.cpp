#include "targets/kernel_process.h"

bool VSKernelProcess::initWithBsdInfo(const VSBsdInfo &info) {
    if (!VSProcess::initWithBsdInfo(info)) {
        return false;
    }
    _setIdleExitStatus(VSIdleExitUnsupported);
    return true;
}

void VSKernelProcess::gatherData() {
    _addError("not supported yet");
    setMemoryRegions({});
}
