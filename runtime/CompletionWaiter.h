#pragma once

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>

namespace tamber {

// The one finish-once guard between a provider's completion handlers and a host that waits for
// them. The first `finish` delivers the outcome; every later one is refused (and reported by
// its false result), so that a provider that completes twice cannot change an answer already
// given or wake a waiter twice. Share it (`std::make_shared`) with the completion: a handler
// that runs after the waiter gave up still finds it alive.
template <class T>
class CompletionWaiter {
public:
    // Delivers `outcome` unless one was delivered before; true when this call delivered it.
    bool finish(T outcome) {
        {
            std::lock_guard lock(mutex_);
            if (outcome_)
                return false;
            outcome_.emplace(std::move(outcome));
        }
        finished_.notify_all();
        return true;
    }

    // Whether an outcome was delivered.
    bool finished() const {
        std::lock_guard lock(mutex_);
        return outcome_.has_value();
    }

    // Waits for the outcome and hands it over. Call once.
    T wait() {
        std::unique_lock lock(mutex_);
        finished_.wait(lock, [&] { return outcome_.has_value(); });
        return takeLocked();
    }

    // The outcome, or nothing when none came within `timeoutSeconds`; call until it comes.
    std::optional<T> waitFor(double timeoutSeconds) {
        std::unique_lock lock(mutex_);
        if (!finished_.wait_for(lock, std::chrono::duration<double>(timeoutSeconds),
                                [&] { return outcome_.has_value(); }))
            return std::nullopt;
        return takeLocked();
    }

private:
    // The outcome stays marked as delivered (a late finish is still refused) once taken.
    T takeLocked() { return std::move(*outcome_); }

    mutable std::mutex mutex_;
    std::condition_variable finished_;
    std::optional<T> outcome_;
};

}  // namespace tamber
