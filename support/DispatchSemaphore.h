#pragma once

#include <condition_variable>
#include <cstdint>

#include "support/Mutex.h"

namespace tamber {

// A counting semaphore. wait() takes one unit, waiting for a signal() when there is none.
// Waiting inside a block of the global queue frees its place there for other blocks.
class DispatchSemaphore {
public:
    explicit DispatchSemaphore(int64_t value = 0);
    DispatchSemaphore(const DispatchSemaphore&) = delete;
    DispatchSemaphore& operator=(const DispatchSemaphore&) = delete;

    void signal();
    void wait();
    // Whether a unit was taken before `timeoutSeconds` passed.
    bool wait(double timeoutSeconds);

private:
    Mutex mutex_;
    std::condition_variable available_;
    int64_t value_ GUARDED_BY(mutex_);
};

}  // namespace tamber
