#pragma once

#include <condition_variable>
#include <cstddef>
#include <functional>
#include <mutex>
#include <vector>

namespace tamber {

// The threads that run queue work. A task never waits for a free thread: when no worker is
// idle a new one starts, so a block that sleeps or waits cannot hold up any other queue.
// Workers that stay idle for a few seconds exit. Internal to the dispatch layer.
class WorkerPool {
public:
    static WorkerPool& shared();

    // Runs `task` on some worker thread, right away. The task must not throw.
    void submit(std::function<void()> task);

    // Live worker threads, busy or idle.
    size_t threadCount() const;

private:
    struct Worker {
        std::condition_variable wake;
        std::function<void()> task;
    };

    WorkerPool() = default;
    void run(std::function<void()> task);

    mutable std::mutex mutex_;
    std::vector<Worker*> idle_;  // most recently idle last: reusing it lets the others expire
    size_t threads_ = 0;
};

}  // namespace tamber
