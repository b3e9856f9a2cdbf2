#pragma once

#include <mutex>

#include "support/ThreadAnnotations.h"

namespace tamber {

class MutexLock;

// A std::mutex the thread-safety analysis knows about: members it guards say so with
// GUARDED_BY(mutex_), and the analysis checks every access under clang. Hold it with MutexLock.
class CAPABILITY("mutex") Mutex {
public:
    Mutex() = default;
    Mutex(const Mutex&) = delete;
    Mutex& operator=(const Mutex&) = delete;

    void lock() ACQUIRE() { mutex_.lock(); }
    void unlock() RELEASE() { mutex_.unlock(); }
    bool try_lock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }

    // For code the analysis cannot follow into (a condition variable's predicate, say): states
    // that the caller holds the mutex. It checks nothing at run time.
    void assertHeld() const ASSERT_CAPABILITY(this) {}

private:
    friend class MutexLock;
    std::mutex mutex_;
};

}  // namespace tamber
