#include "support/DispatchTimer.h"

#include <algorithm>
#include <exception>
#include <system_error>
#include <thread>

#include "support/Log.h"

namespace tamber {

namespace {

constexpr auto kIdleLifetime = std::chrono::seconds(5);

struct Later {
    template <class E>
    bool operator()(const E& a, const E& b) const {
        if (a.deadline != b.deadline)
            return a.deadline > b.deadline;
        return a.sequence > b.sequence;
    }
};

}  // namespace

DispatchTimer& DispatchTimer::shared() {
    static DispatchTimer* timer = new DispatchTimer();  // never destroyed: its thread outlives main
    return *timer;
}

DispatchTimer::Clock::time_point DispatchTimer::deadlineAfter(double seconds) {
    constexpr double kMaxSeconds = 100.0 * 365 * 24 * 3600;
    auto now = Clock::now();
    if (!(seconds > 0))
        return now;
    return now + std::chrono::ceil<Clock::duration>(
                     std::chrono::duration<double>(std::min(seconds, kMaxSeconds)));
}

void DispatchTimer::schedule(Clock::time_point deadline, std::function<void()> fire) {
    std::unique_lock lock(mutex_);
    heap_.push_back({deadline, nextSequence_++, std::move(fire)});
    std::push_heap(heap_.begin(), heap_.end(), Later{});
    if (threadRunning_) {
        changed_.notify_one();
        return;
    }
    threadRunning_ = true;
    lock.unlock();
    try {
        std::thread([this] { run(); }).detach();
    } catch (const std::system_error& e) {
        fatalError(std::string("cannot start the timer thread: ") + e.what());
    }
}

void DispatchTimer::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        if (heap_.empty()) {
            if (!changed_.wait_for(lock, kIdleLifetime, [&] { return !heap_.empty(); })) {
                threadRunning_ = false;
                return;
            }
            continue;
        }
        auto deadline = heap_.front().deadline;
        if (Clock::now() < deadline) {
            changed_.wait_until(lock, deadline);
            continue;
        }
        std::pop_heap(heap_.begin(), heap_.end(), Later{});
        auto fire = std::move(heap_.back().fire);
        heap_.pop_back();
        lock.unlock();
        try {
            fire();
        } catch (const std::exception& e) {
            logError(std::string("delayed work failed: ") + e.what());
        } catch (...) {
            logError("delayed work failed with an unknown exception");
        }
        fire = nullptr;  // drop the captures outside the lock
        lock.lock();
    }
}

}  // namespace tamber
