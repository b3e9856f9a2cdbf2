#pragma once

#include <mutex>

#include "support/Mutex.h"
#include "support/ThreadAnnotations.h"

namespace tamber {

// Holds a Mutex for its scope. `native()` is the underlying std::unique_lock, for waiting on a
// std::condition_variable; a wait gives the mutex up and takes it back before returning, so the
// lock is held again whenever the analysis looks.
class SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : lock_(mutex.mutex_) {}
    ~MutexLock() RELEASE() {}
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

    // Gives the mutex up before the scope ends (and takes it again); the destructor releases it
    // only when held.
    void unlock() RELEASE() { lock_.unlock(); }
    void lock() ACQUIRE() { lock_.lock(); }

    std::unique_lock<std::mutex>& native() { return lock_; }

private:
    std::unique_lock<std::mutex> lock_;
};

}  // namespace tamber
