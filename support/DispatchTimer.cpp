#include "support/DispatchTimer.h"

#include <algorithm>
#include <exception>
#include <system_error>
#include <thread>

#include "support/Log.h"
#include "support/ProcessWide.h"

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
    static ProcessWide<DispatchTimer> timer;
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
    // The previous thread, if any, has left run() (it cleared threadRunning_ on its way out).
    if (thread_.joinable())
        thread_.join();
    threadRunning_ = true;
    try {
        thread_ = std::thread([this] { run(); });
    } catch (const std::system_error& e) {
        fatalError(std::string("cannot start the timer thread: ") + e.what());
    }
}

void DispatchTimer::shutdown() {
    std::unique_lock lock(mutex_);
    stopping_ = true;
    std::vector<Entry> dropped = std::move(heap_);
    heap_.clear();
    changed_.notify_all();
    std::thread thread = std::move(thread_);
    lock.unlock();
    if (thread.joinable())
        thread.join();
    dropped.clear();  // captures go outside the lock
    lock.lock();
    stopping_ = false;
}

void DispatchTimer::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        if (stopping_) {
            threadRunning_ = false;
            return;
        }
        if (heap_.empty()) {
            if (!changed_.wait_for(lock, kIdleLifetime,
                                   [&] { return !heap_.empty() || stopping_; })) {
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
