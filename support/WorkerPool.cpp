#include "support/WorkerPool.h"

#include <algorithm>
#include <chrono>
#include <exception>
#include <system_error>
#include <thread>

#include "support/Log.h"

namespace tamber {

namespace {

constexpr auto kIdleLifetime = std::chrono::seconds(5);

}  // namespace

WorkerPool& WorkerPool::shared() {
    static WorkerPool* pool = new WorkerPool();  // never destroyed: workers outlive main
    return *pool;
}

void WorkerPool::submit(std::function<void()> task) {
    std::unique_lock lock(mutex_);
    if (!idle_.empty()) {
        Worker* worker = idle_.back();
        idle_.pop_back();
        worker->task = std::move(task);
        // Still under the lock: the worker cannot time out and leave before it is woken.
        worker->wake.notify_one();
        return;
    }
    ++threads_;
    lock.unlock();
    try {
        std::thread([this, t = std::move(task)]() mutable { run(std::move(t)); }).detach();
    } catch (const std::system_error& e) {
        fatalError(std::string("cannot start a worker thread: ") + e.what());
    }
}

size_t WorkerPool::threadCount() const {
    std::lock_guard lock(mutex_);
    return threads_;
}

void WorkerPool::run(std::function<void()> task) {
    Worker self;
    for (;;) {
        try {
            task();
        } catch (const std::exception& e) {
            logError(std::string("worker task failed: ") + e.what());
        } catch (...) {
            logError("worker task failed with an unknown exception");
        }
        task = nullptr;  // release what the task captured before going idle

        std::unique_lock lock(mutex_);
        idle_.push_back(&self);
        if (!self.wake.wait_for(lock, kIdleLifetime, [&] { return bool(self.task); })) {
            idle_.erase(std::find(idle_.begin(), idle_.end(), &self));
            --threads_;
            return;
        }
        task = std::move(self.task);
        self.task = nullptr;
    }
}

}  // namespace tamber
