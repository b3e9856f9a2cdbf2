#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace tamber {

template <class T>
class ProcessWide;

// Waits for the deadlines of delayed work and fires each entry when it is due, from its own
// thread (started on demand, gone after a few idle seconds, joined by the next schedule or by
// shutdown()). Firing must be quick: the queues
// use it only to hand the block over to themselves. Entries with the same deadline fire in the
// order they were scheduled.
class DispatchTimer {
public:
    using Clock = std::chrono::steady_clock;

    static DispatchTimer& shared();

    void schedule(Clock::time_point deadline, std::function<void()> fire);

    // Drops the entries not due yet (releasing what they captured) and joins the thread; a
    // later schedule starts it again. Called when the runtime that scheduled them goes away,
    // from a host's thread: never from a firing entry, whose thread it would wait for.
    void shutdown();

    // Now plus `seconds`, rounded up so nothing happens early; not positive means now, and
    // absurdly long delays are capped rather than overflowing the clock.
    static Clock::time_point deadlineAfter(double seconds);

private:
    struct Entry {
        Clock::time_point deadline;
        uint64_t sequence;
        std::function<void()> fire;
    };

    friend class ProcessWide<DispatchTimer>;

    DispatchTimer() = default;
    void run();

    std::mutex mutex_;
    std::condition_variable changed_;  // guarded by mutex_
    std::vector<Entry> heap_;     // guarded by mutex_; earliest first (push_heap, reversed order)
    uint64_t nextSequence_ = 0;   // guarded by mutex_
    bool threadRunning_ = false;  // guarded by mutex_
    bool stopping_ = false;       // guarded by mutex_
    std::thread thread_;          // guarded by mutex_; joinable until joined
};

}  // namespace tamber
