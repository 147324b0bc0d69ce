#include "analysis/interrupt_source.h"

// Signal masks and the terminal test have no standard C++ spelling.
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "model/assert.h"

namespace vs {

struct InterruptSource::State {
    std::function<void()> callback;
    std::atomic<bool> cancelled{false};
    sigset_t previousMask{};
    std::thread waiter;
};

InterruptSource::InterruptSource(std::function<void()> callback) : _state(std::make_unique<State>()) {
    _state->callback = std::move(callback);
    sigset_t interrupt;
    sigemptyset(&interrupt);
    sigaddset(&interrupt, SIGINT);
    const int blocked = pthread_sigmask(SIG_BLOCK, &interrupt, &_state->previousMask);
    VS_ASSERT(blocked == 0);

    State *state = _state.get();
    state->waiter = std::thread([state, interrupt] {
        for (;;) {
            int signal = 0;
            if (sigwait(&interrupt, &signal) != 0) {
                continue;
            }
            if (state->cancelled.load()) {
                return;
            }
            state->callback();
        }
    });
}

InterruptSource::~InterruptSource() { cancel(); }

void InterruptSource::cancel() {
    if (!_state->waiter.joinable()) {
        return;
    }
    // Wake the waiter with a signal aimed at it alone; seeing the flag it
    // returns without running the callback.
    _state->cancelled.store(true);
    pthread_kill(_state->waiter.native_handle(), SIGINT);
    _state->waiter.join();
    pthread_sigmask(SIG_SETMASK, &_state->previousMask, nullptr);
}

bool standardOutputIsTerminal() { return isatty(1) == 1; }

} // namespace vs
