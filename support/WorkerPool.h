#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <list>
#include <mutex>
#include <thread>
#include <vector>

namespace tamber {

template <class T>
class ProcessWide;

// The threads that run queue work, at most kMaxThreads of them. While fewer are alive a task
// never waits for a free thread: when no worker is idle a new one starts, so a block that
// sleeps or waits cannot hold up another queue. At the bound, tasks wait in order for the
// next worker that comes free. Workers that stay idle for a few seconds exit; every thread is
// joined, by a later submit or by shutdown(). Internal to the dispatch layer.
//
// What keeps the bound from deadlocking: queue blocks wait for each other in two places only,
// a listing's gather phase (blocks of the global queue wait on a semaphore that another block
// signals) and the shared app-library manager's upgrade (a block waits for the background
// refresh). The global queue runs at most max(4, cores) blocks plus one extra per stall
// interval, and each of those waits depends on one block only, so a chain of waiters needs
// far fewer than kMaxThreads workers; a host that runs more concurrent listings than that
// queues them rather than starting threads without end.
class WorkerPool {
public:
    static constexpr size_t kMaxThreads = 64;

    static WorkerPool& shared();

    // Runs `task` on some worker thread: right away while a worker is idle or fewer than
    // kMaxThreads are alive, else when one comes free. The task must not throw.
    void submit(std::function<void()> task);

    // Waits until every task submitted so far, and every task those submit, has run, then
    // joins every worker. The pool can be used again afterwards. Callers stop what keeps
    // submitting work (streams, timers) first; a task that never ends keeps this waiting, and
    // so would a call from a task (it waits for itself): call it from a host's own thread.
    void shutdown();

    // Live worker threads, busy or idle.
    size_t threadCount() const;

private:
    friend class ProcessWide<WorkerPool>;

    WorkerPool() = default;
    void run();
    // Joins the workers that exited on their own. Called with the lock held.
    void reapExited(std::unique_lock<std::mutex>& lock);

    mutable std::mutex mutex_;
    std::condition_variable wake_;   // guarded by mutex_: a task came, or workers must leave
    std::condition_variable quiet_;  // guarded by mutex_: the last busy worker went idle
    std::deque<std::function<void()>> tasks_;  // guarded by mutex_
    std::list<std::thread> workers_;           // guarded by mutex_: alive or not joined yet
    std::vector<std::thread::id> exited_;      // guarded by mutex_: returned, to be joined
    size_t threads_ = 0;                       // guarded by mutex_: alive
    size_t idle_ = 0;                          // guarded by mutex_: alive and waiting
    bool leave_ = false;                       // guarded by mutex_: shutdown asks idle ones out
};

}  // namespace tamber
