#pragma once

// Shared set-up of the target tests: a quiet scripted platform, installed
// for the test's lifetime, and small target subclasses that reach the
// protected set-up the factories use.

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

    // Declared first so that it outlives the targets a test makes.
    VSFakePlatform fake;
    std::unique_ptr<VSFakePlatform::Installation> installation = fake.install();
};

// A live user process made the way the factory makes one.
inline std::unique_ptr<VSUserProcess> userProcess(int32_t pid) {
    std::unique_ptr<VSProcess> process = VSProcess::processWithPid(pid);
    auto *user = dynamic_cast<VSUserProcess *>(process.get());
    if (user == nullptr) {
        return nullptr;
    }
    process.release();
    return std::unique_ptr<VSUserProcess>(user);
}

// A user process whose live state can no longer be asked for (what a crash
// snapshot is): failures are never excused as an exit.
class NotAliveProcess : public VSUserProcess {
public:
    static std::unique_ptr<NotAliveProcess> make(int32_t pid) {
        VSBsdInfo info;
        if (VSPlatform::current().pid_bsd_info(pid, info) != static_cast<int32_t>(sizeof info)) {
            return nullptr;
        }
        auto process = std::make_unique<NotAliveProcess>();
        if (!process->initWithBsdInfo(info)) {
            return nullptr;
        }
        return process;
    }
    bool _isAlive() const override { return false; }
};

// A target of no particular kind that never determines its idle-exit state.
class BareTarget : public VSProcess {
public:
    static std::unique_ptr<BareTarget> make(int32_t pid) {
        VSBsdInfo info;
        info.pid = static_cast<uint32_t>(pid);
        auto target = std::make_unique<BareTarget>();
        if (!target->initWithBsdInfo(info)) {
            return nullptr;
        }
        return target;
    }

protected:
    bool _populateTask() override { return true; }
};

}  // namespace vs::testing
