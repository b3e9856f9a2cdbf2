#include "support/DispatchSemaphore.h"

#include <chrono>
#include <string>

#include "support/BlockingScope.h"
#include "support/DispatchTimer.h"
#include "support/Log.h"

namespace tamber {

DispatchSemaphore::DispatchSemaphore(int64_t value) : value_(value) {
    if (value < 0)
        fatalError("a semaphore cannot start below zero: " + std::to_string(value));
}

void DispatchSemaphore::signal() {
    std::lock_guard lock(mutex_);
    ++value_;
    available_.notify_one();
}

void DispatchSemaphore::wait() {
    std::unique_lock lock(mutex_);
    if (value_ == 0) {
        BlockingScope waiting;
        available_.wait(lock, [&] { return value_ > 0; });
    }
    --value_;
}

bool DispatchSemaphore::wait(double timeoutSeconds) {
    auto deadline = DispatchTimer::deadlineAfter(timeoutSeconds);
    std::unique_lock lock(mutex_);
    if (value_ == 0) {
        BlockingScope waiting;
        if (!available_.wait_until(lock, deadline, [&] { return value_ > 0; }))
            return false;
    }
    --value_;
    return true;
}

}  // namespace tamber
