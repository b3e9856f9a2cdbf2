#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include <httplib.h>

namespace tamber {

// The threads that serve connections, shared by the server's listening sockets so that the
// limit holds for all of them together: at most `threads` connections are served at once;
// connections accepted beyond that wait, in order, for a thread.
class ConnectionPool {
public:
    explicit ConnectionPool(size_t threads);
    ~ConnectionPool();
    ConnectionPool(const ConnectionPool&) = delete;
    ConnectionPool& operator=(const ConnectionPool&) = delete;

    // A task queue for one listening socket. Its shutdown() (called by the listener when it
    // stops) waits for the connections it handed over to finish; the pool's threads stay.
    std::unique_ptr<httplib::TaskQueue> queueForListener();

    // Runs the connections still waiting, then joins the threads. Harmless to call twice.
    void shutdown();

private:
    struct Tracker;
    void enqueue(std::function<void()> task);
    void work();

    std::mutex mutex_;
    std::condition_variable wake_;
    std::deque<std::function<void()>> tasks_;  // guarded by mutex_
    bool stopping_ = false;                    // guarded by mutex_
    std::vector<std::thread> threads_;
};

}  // namespace tamber
