#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <vector>

namespace tamber {

// Waits for the deadlines of delayed work and fires each entry when it is due, from its own
// thread (started on demand, gone after a few idle seconds). Firing must be quick: the queues
// use it only to hand the block over to themselves. Entries with the same deadline fire in the
// order they were scheduled.
class DispatchTimer {
public:
    using Clock = std::chrono::steady_clock;

    static DispatchTimer& shared();

    void schedule(Clock::time_point deadline, std::function<void()> fire);

    // Now plus `seconds`, rounded up so nothing happens early; not positive means now, and
    // absurdly long delays are capped rather than overflowing the clock.
    static Clock::time_point deadlineAfter(double seconds);

private:
    struct Entry {
        Clock::time_point deadline;
        uint64_t sequence;
        std::function<void()> fire;
    };

    DispatchTimer() = default;
    void run();

    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<Entry> heap_;  // earliest first (std::push_heap with a reversed order)
    uint64_t nextSequence_ = 0;
    bool threadRunning_ = false;
};

}  // namespace tamber
