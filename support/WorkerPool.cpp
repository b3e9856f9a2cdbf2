#include "support/WorkerPool.h"

#include <algorithm>
#include <chrono>
#include <exception>
#include <system_error>

#include "support/Log.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

constexpr auto kWorkerIdleLifetime = std::chrono::seconds(5);

}  // namespace

WorkerPool& WorkerPool::shared() {
    // Blocks may still be submitted while the process exits.
    static ProcessWide<WorkerPool> pool;
    return *pool;
}

void WorkerPool::submit(std::function<void()> task) {
    std::unique_lock lock(mutex_);
    reapExited(lock);
    tasks_.push_back(std::move(task));
    if (tasks_.size() <= idle_ || threads_ >= kMaxThreads) {
        wake_.notify_one();
        return;
    }
    try {
        workers_.emplace_back([this] { run(); });
        ++threads_;
    } catch (const std::system_error& e) {
        // Another worker will take the task when it comes free; with none there is no one.
        if (threads_ == 0)
            fatalError(std::string("cannot start a worker thread: ") + e.what());
        logError(std::string("cannot start a worker thread: ") + e.what());
    }
}

void WorkerPool::shutdown() {
    std::unique_lock lock(mutex_);
    // Tasks may submit more tasks: wait until nothing is queued and nobody is busy.
    quiet_.wait(lock, [&] { return tasks_.empty() && idle_ == threads_; });
    leave_ = true;
    wake_.notify_all();
    while (!workers_.empty()) {
        std::thread worker = std::move(workers_.front());
        workers_.pop_front();
        lock.unlock();
        if (worker.joinable())
            worker.join();
        lock.lock();
    }
    exited_.clear();
    leave_ = false;
}

size_t WorkerPool::threadCount() const {
    std::lock_guard lock(mutex_);
    return threads_;
}

void WorkerPool::reapExited(std::unique_lock<std::mutex>& lock) {
    if (exited_.empty())
        return;
    std::vector<std::thread> done;
    for (auto id : exited_) {
        auto it = std::find_if(workers_.begin(), workers_.end(),
                               [&](const std::thread& t) { return t.get_id() == id; });
        if (it != workers_.end()) {
            done.push_back(std::move(*it));
            workers_.erase(it);
        }
    }
    exited_.clear();
    lock.unlock();
    for (auto& thread : done) thread.join();  // they have returned from run() already
    lock.lock();
}

void WorkerPool::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        ++idle_;
        if (idle_ == threads_ && tasks_.empty())
            quiet_.notify_all();
        bool woken =
            wake_.wait_for(lock, kWorkerIdleLifetime, [&] { return !tasks_.empty() || leave_; });
        --idle_;
        if (tasks_.empty()) {
            if (woken && !leave_)
                continue;
            // Idle too long, or shutting down: leave, to be joined by someone else.
            --threads_;
            if (!leave_)
                exited_.push_back(std::this_thread::get_id());
            if (idle_ == threads_)
                quiet_.notify_all();
            return;
        }
        std::function<void()> task = std::move(tasks_.front());
        tasks_.pop_front();
        lock.unlock();
        try {
            task();
        } catch (const std::exception& e) {
            logError(std::string("worker task failed: ") + e.what());
        } catch (...) {
            logError("worker task failed with an unknown exception");
        }
        task = nullptr;  // release what the task captured before going idle
        lock.lock();
    }
}

}  // namespace tamber
