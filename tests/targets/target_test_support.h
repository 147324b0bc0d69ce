#pragma once

// Target tests run on a quiet scripted platform, installed for the test's lifetime.

#include <gtest/gtest.h>

#include <memory>

#include "targets/platform/testing/fake_platform.h"
#include "targets/process.h"
#include "targets/user_process.h"

namespace vs::testing {

class TargetTest : public ::testing::Test {
protected:
    TargetTest() {
        fake.errorStream(nullptr);
        VSProcess::_clearGlobalErrors();
    }
    ~TargetTest() override { VSProcess::_clearGlobalErrors(); }

    VSFakePlatform fake;  // declared first: outlives the targets a test makes
    std::unique_ptr<VSFakePlatform::Installation> installation = fake.install();
};

// A factory-made target as the kind a test expects, or null.
template <class Kind>
std::unique_ptr<Kind> as(std::unique_ptr<VSProcess> process) {
    Kind *kind = dynamic_cast<Kind *>(process.get());
    return std::unique_ptr<Kind>(kind ? static_cast<Kind *>(process.release()) : nullptr);
}

inline std::unique_ptr<VSUserProcess> userProcess(int32_t pid, bool gather = false) {
    auto process = as<VSUserProcess>(VSProcess::processWithPid(pid));
    if (process && gather) {
        process->gatherData();
    }
    return process;
}

// A user process whose live state can no longer be asked for: failures are never excused as an exit.
class NotAliveProcess : public VSUserProcess {
public:
    static std::unique_ptr<NotAliveProcess> make(int32_t pid) {
        VSBsdInfo info;
        auto process = std::make_unique<NotAliveProcess>();
        if (VSPlatform::current().pid_bsd_info(pid, info) != static_cast<int32_t>(sizeof info) ||
            !process->initWithBsdInfo(info)) {
            return nullptr;
        }
        return process;
    }
    bool _isAlive() const override { return false; }
};

}  // namespace vs::testing
