#pragma once

// The kernel as a target (pid 0). Its memory is read by zone and wired-memory
// site rather than region by region; until that reading exists the target
// is created like the finished one (so -a, -p 0 and the factory behave as
// they will) and reports that it has nothing yet.

#include "targets/process.h"

class VSKernelProcess : public VSProcess {
public:
    VSKernelProcess() = default;

    void gatherData() override;
    bool _isAlive() const override { return true; }

protected:
    bool initWithBsdInfo(const VSBsdInfo &info) override;
    bool _populateTask() override { return true; }
};
