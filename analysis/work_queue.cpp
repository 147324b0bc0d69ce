#include "analysis/work_queue.h"

#include <algorithm>
#include <atomic>
#include <exception>
#include <mutex>
#include <thread>
#include <vector>

namespace vs {

WorkQueue::WorkQueue(std::string label, unsigned width) : _label(std::move(label)), _width(width) {
    if (_width == 0) {
        _width = std::max(1u, std::thread::hardware_concurrency());
    }
}

void WorkQueue::parallel_for(std::size_t count, const std::function<void(std::size_t)> &body) {
    if (count == 0) {
        return;
    }
    std::atomic<std::size_t> next{0};
    std::atomic<bool> failed{false};
    std::exception_ptr firstFailure;
    std::mutex failureLock;

    auto work = [&] {
        while (!failed.load(std::memory_order_relaxed)) {
            const std::size_t index = next.fetch_add(1);
            if (index >= count) {
                return;
            }
            try {
                body(index);
            } catch (...) {
                std::lock_guard<std::mutex> guard(failureLock);
                if (!firstFailure) {
                    firstFailure = std::current_exception();
                }
                failed.store(true);
            }
        }
    };

    const std::size_t workers = std::min<std::size_t>(_width, count);
    std::vector<std::thread> threads;
    threads.reserve(workers);
    for (std::size_t i = 0; i < workers; ++i) {
        threads.emplace_back(work);
    }
    for (std::thread &thread : threads) {
        thread.join();
    }
    if (firstFailure) {
        std::rethrow_exception(firstFailure);
    }
}

} // namespace vs
