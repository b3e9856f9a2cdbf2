#include "support/DispatchSemaphore.h"

#include <chrono>
#include <string>

#include "support/BlockingScope.h"
#include "support/DispatchTimer.h"
#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

DispatchSemaphore::DispatchSemaphore(int64_t value) : value_(value) {
    if (value < 0)
        fatalError("a semaphore cannot start below zero: " + std::to_string(value));
}

void DispatchSemaphore::signal() {
    MutexLock lock(mutex_);
    ++value_;
    available_.notify_one();
}

void DispatchSemaphore::wait() {
    MutexLock lock(mutex_);
    if (value_ == 0) {
        BlockingScope waiting;
        available_.wait(lock.native(), [&] {
            mutex_.assertHeld();
            return value_ > 0;
        });
    }
    --value_;
}

bool DispatchSemaphore::wait(double timeoutSeconds) {
    auto deadline = DispatchTimer::deadlineAfter(timeoutSeconds);
    MutexLock lock(mutex_);
    if (value_ == 0) {
        BlockingScope waiting;
        if (!available_.wait_until(lock.native(), deadline, [&] {
                mutex_.assertHeld();
                return value_ > 0;
            }))
            return false;
    }
    --value_;
    return true;
}

}  // namespace tamber
