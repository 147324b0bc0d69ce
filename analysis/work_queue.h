#pragma once

// A pool of worker threads for one parallel phase. Iterations are handed
// out in ascending index order, so the caller decides which work starts
// first; each worker takes the next index when it is free.

#include <cstddef>
#include <functional>
#include <string>

namespace vs {

class WorkQueue {
public:
    // width 0 means one worker per processor of the machine.
    explicit WorkQueue(std::string label, unsigned width = 0);

    const std::string &label() const { return _label; }
    unsigned width() const { return _width; }

    // Runs body(0) .. body(count - 1), each exactly once, on the pool and
    // returns when every iteration has finished. An exception escaping an
    // iteration stops the handing out of further indices and is rethrown
    // here after the running iterations have ended.
    void parallel_for(std::size_t count, const std::function<void(std::size_t)> &body);

private:
    std::string _label;
    unsigned _width;
};

} // namespace vs
