// The interrupt source, with real threads and real signals. Standard output points at a pseudo-terminal or at /dev/null for
// the length of a test, since the source exists only for the latter.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "analysis/vestage.h"

namespace {

class StandardOutputRedirect {
public:
    explicit StandardOutputRedirect(int fd) : _saved(dup(1)) {
        std::fflush(stdout);
        dup2(fd, 1);
    }
    ~StandardOutputRedirect() {
        std::fflush(stdout);
        dup2(_saved, 1);
        close(_saved);
    }

private:
    int _saved;
};

bool interruptBlocked() {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    return sigismember(&mask, SIGINT) == 1;
}

} // namespace

TEST(InterruptSource, NoneWhenStandardOutputIsATerminal) {
    const int primary = posix_openpt(O_RDWR | O_NOCTTY);
    ASSERT_GE(primary, 0);
    ASSERT_EQ(grantpt(primary) | unlockpt(primary), 0);
    const int terminal = open(ptsname(primary), O_RDWR | O_NOCTTY);
    ASSERT_GE(terminal, 0);
    {
        StandardOutputRedirect redirect(terminal);
        EXPECT_EQ(VSVestage::installCancelHandler([] {}), nullptr);
        EXPECT_FALSE(interruptBlocked());
    }
    close(terminal);
    close(primary);
}

TEST(InterruptSource, InterruptRunsTheCallbackOnAnotherThreadUntilCancelled) {
    const int devNull = open("/dev/null", O_WRONLY);
    ASSERT_GE(devNull, 0);
    StandardOutputRedirect redirect(devNull);

    std::mutex lock;
    std::condition_variable called;
    int calls = 0;
    std::thread::id callbackThread;
    auto source = VSVestage::installCancelHandler([&] {
        std::lock_guard<std::mutex> guard(lock);
        ++calls;
        callbackThread = std::this_thread::get_id();
        called.notify_all();
    });
    ASSERT_NE(source, nullptr);
    // Threads started from now on (the gathering workers) keep it blocked.
    bool workerBlocked = false;
    std::thread([&] { workerBlocked = interruptBlocked(); }).join();
    EXPECT_TRUE(workerBlocked);

    // Without the source this would end the test program.
    ASSERT_EQ(kill(getpid(), SIGINT), 0);
    {
        std::unique_lock<std::mutex> guard(lock);
        // The bound only turns a broken source into a failure instead of a hang.
        ASSERT_TRUE(called.wait_for(guard, std::chrono::seconds(60), [&] { return calls > 0; }));
        EXPECT_NE(callbackThread, std::this_thread::get_id());
    }
    source->cancel();
    source->cancel();
    EXPECT_FALSE(interruptBlocked());
    std::lock_guard<std::mutex> guard(lock);
    EXPECT_EQ(calls, 1);
    close(devNull);
}
