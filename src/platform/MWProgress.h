#pragma once

#include <atomic>
#include <cstdint>

/// How far the work of a thread has come. Work on a watched queue (see MWConcurrentQueue) marks each step
/// that the system has answered: what does not get any further is given up.
class MWProgress {
public:
    /// The thread's work has got a step further. Costs nothing to speak of; harmless outside of watched work.
    static void mark() {
        if (_steps != nullptr) {
            _steps->fetch_add(1, std::memory_order_relaxed);
        }
    }
    /// Where the calling thread's steps are counted from now on; may be null.
    static void countIn(std::atomic<uint64_t>* steps) { _steps = steps; }

private:
    inline static thread_local std::atomic<uint64_t>* _steps = nullptr;
};
