#include "server/ConnectionPool.h"

namespace tamber {

// Counts what one listener handed over, so that its shutdown waits for exactly that.
struct ConnectionPool::Tracker : httplib::TaskQueue {
    explicit Tracker(ConnectionPool& pool) : pool(pool) {}

    void enqueue(std::function<void()> fn) override {
        {
            std::lock_guard lock(state->mutex);
            ++state->running;
        }
        auto shared = state;
        pool.enqueue([fn = std::move(fn), shared] {
            fn();
            std::lock_guard lock(shared->mutex);
            if (--shared->running == 0)
                shared->idle.notify_all();
        });
    }
    void shutdown() override {
        std::unique_lock lock(state->mutex);
        state->idle.wait(lock, [&] { return state->running == 0; });
    }

    struct State {
        std::mutex mutex;
        std::condition_variable idle;
        size_t running = 0;
    };
    ConnectionPool& pool;
    std::shared_ptr<State> state = std::make_shared<State>();
};

ConnectionPool::ConnectionPool(size_t threads) {
    for (size_t i = 0; i < threads; ++i) threads_.emplace_back([this] { work(); });
}

ConnectionPool::~ConnectionPool() {
    shutdown();
}

std::unique_ptr<httplib::TaskQueue> ConnectionPool::queueForListener() {
    return std::make_unique<Tracker>(*this);
}

void ConnectionPool::enqueue(std::function<void()> task) {
    {
        std::lock_guard lock(mutex_);
        tasks_.push_back(std::move(task));
    }
    wake_.notify_one();
}

void ConnectionPool::work() {
    for (;;) {
        std::function<void()> task;
        {
            std::unique_lock lock(mutex_);
            wake_.wait(lock, [&] { return stopping_ || !tasks_.empty(); });
            if (tasks_.empty())
                return;
            task = std::move(tasks_.front());
            tasks_.pop_front();
        }
        task();
    }
}

void ConnectionPool::shutdown() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_all();
    for (auto& thread : threads_)
        if (thread.joinable())
            thread.join();
    threads_.clear();
}

}  // namespace tamber
