#pragma once

// SIGINT as an ordinary event. While an InterruptSource exists, SIGINT is
// blocked and a thread of its own waits for it, so the callback runs on a
// plain thread (it may lock, allocate and write) instead of in a signal
// handler. Threads started after construction inherit the blocked mask,
// which is why the source is created before the gathering workers.
// Signals that arrive close together may be merged into one callback run.

#include <functional>
#include <memory>

namespace vs {

class InterruptSource {
public:
    // Blocks SIGINT in the calling thread and starts waiting for it.
    explicit InterruptSource(std::function<void()> callback);
    // Cancels.
    ~InterruptSource();

    InterruptSource(const InterruptSource &) = delete;
    InterruptSource &operator=(const InterruptSource &) = delete;

    // Stops waiting, then restores the calling thread's previous signal
    // mask, so an interrupt is delivered in the normal way again (one that
    // arrived meanwhile is delivered at once). Call it on the thread that
    // created the source. Repeated calls do nothing.
    void cancel();

private:
    struct State;
    std::unique_ptr<State> _state;
};

// Whether file descriptor 1 is a terminal.
bool standardOutputIsTerminal();

} // namespace vs
