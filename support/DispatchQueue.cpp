#include "support/DispatchQueue.h"

#include <algorithm>
#include <cmath>
#include <exception>
#include <thread>
#include <vector>

#include "support/DispatchTimer.h"
#include "support/Log.h"
#include "support/ProcessWide.h"
#include "support/WorkerPool.h"

namespace tamber {

namespace {

// How long the global queue may make no progress while blocks wait for a slot before it runs
// one more anyway: its running blocks may be stuck on something it cannot see (a lock, a
// future, a read) that one of the waiting blocks would resolve.
constexpr auto kStallInterval = std::chrono::milliseconds(200);

// The queues whose blocks the current thread is running, innermost last.
thread_local std::vector<const DispatchQueue*> tCurrentQueues;

class CurrentQueueScope {
public:
    explicit CurrentQueueScope(const DispatchQueue* queue) { tCurrentQueues.push_back(queue); }
    ~CurrentQueueScope() { tCurrentQueues.pop_back(); }
    CurrentQueueScope(const CurrentQueueScope&) = delete;
    CurrentQueueScope& operator=(const CurrentQueueScope&) = delete;
};

size_t globalWidth() {
    return std::max<size_t>(4, std::thread::hardware_concurrency());
}

}  // namespace

std::shared_ptr<DispatchQueue> DispatchQueue::makeSerial(std::string label) {
    return std::make_shared<DispatchQueue>(Private{}, std::move(label), 1);
}

const std::shared_ptr<DispatchQueue>& DispatchQueue::global() {
    // Blocks may still run while the process exits.
    static ProcessWide<std::shared_ptr<DispatchQueue>> queue(
        std::make_shared<DispatchQueue>(Private{}, "tamber.global", globalWidth()));
    return *queue;
}

DispatchQueue::DispatchQueue(Private, std::string label, size_t width)
    : label_(std::move(label)), width_(width) {}

DispatchQueue::~DispatchQueue() = default;

void DispatchQueue::async(std::function<void()> block) {
    std::unique_lock lock(mutex_);
    if (!isSerial()) {
        startConcurrent(lock, std::move(block));
        return;
    }
    items_.push_back({std::move(block), nullptr});
    if (busy_)
        return;
    busy_ = true;
    lock.unlock();
    WorkerPool::shared().submit([self = shared_from_this()] { self->drainSerial(); });
}

void DispatchQueue::asyncAfter(double delaySeconds, std::function<void()> block) {
    if (!(delaySeconds > 0)) {
        async(std::move(block));
        return;
    }
    asyncAt(DispatchTimer::deadlineAfter(delaySeconds), std::move(block));
}

void DispatchQueue::asyncAt(Clock::time_point deadline, std::function<void()> block) {
    DispatchTimer::shared().schedule(
        deadline,
        [self = shared_from_this(), b = std::move(block)]() mutable { self->async(std::move(b)); });
}

bool DispatchQueue::isCurrent() const {
    return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), this) != tCurrentQueues.end();
}

void DispatchQueue::assertCurrent() const {
    if (!isCurrent())
        fatalError("expected to run on queue " + label_ + ", but it is not current");
}

void DispatchQueue::assertNotCurrent() const {
    if (isCurrent())
        fatalError("expected not to run on queue " + label_ + ", but it is current");
}

void DispatchQueue::runBlock(std::function<void()>& block) {
    CurrentQueueScope current(this);
    try {
        block();
    } catch (const std::exception& e) {
        logError("block on queue " + label_ + " threw: " + e.what());
    } catch (...) {
        logError("block on queue " + label_ + " threw an unknown exception");
    }
}

void DispatchQueue::syncInvoke(Invoke invoke, void* context) {
    if (!isSerial()) {
        CurrentQueueScope current(this);
        invoke(context);
        return;
    }
    if (isCurrent()) {
        fatalError("sync onto queue " + label_ +
                   " from a block already running on it would wait for itself forever");
    }
    {
        std::unique_lock lock(mutex_);
        if (busy_) {
            SyncWaiter waiter;
            items_.push_back({nullptr, &waiter});
            BlockingScope waiting;
            waiter.granted.wait(lock, [&] { return waiter.ownsQueue; });
        } else {
            busy_ = true;
        }
    }
    // The queue is ours until released, whichever way the block ends.
    struct Release {
        DispatchQueue* queue;
        ~Release() {
            std::unique_lock lock(queue->mutex_);
            queue->releaseSerial(lock);
        }
    } release{this};
    CurrentQueueScope current(this);
    invoke(context);
}

// Called with the queue owned and the lock held: passes the queue on to whatever comes next.
void DispatchQueue::releaseSerial(std::unique_lock<std::mutex>& lock) {
    if (items_.empty()) {
        busy_ = false;
        return;
    }
    if (SyncWaiter* waiter = items_.front().waiter) {
        items_.pop_front();
        waiter->ownsQueue = true;
        waiter->granted.notify_one();  // under the lock: the waiter lives on its caller's stack
        return;
    }
    lock.unlock();
    WorkerPool::shared().submit([self = shared_from_this()] { self->drainSerial(); });
}

void DispatchQueue::drainSerial() {
    std::unique_lock lock(mutex_);
    for (;;) {
        if (items_.empty()) {
            busy_ = false;
            return;
        }
        Item item = std::move(items_.front());
        items_.pop_front();
        if (item.waiter) {
            item.waiter->ownsQueue = true;
            item.waiter->granted.notify_one();
            return;
        }
        lock.unlock();
        runBlock(item.block);
        item.block = nullptr;  // captures go before the next block runs
        lock.lock();
    }
}

// Called with the lock held.
void DispatchQueue::startConcurrent(std::unique_lock<std::mutex>& lock,
                                    std::function<void()> block) {
    if (active_ >= width_) {
        items_.push_back({std::move(block), nullptr});
        if (!watching_) {
            watching_ = true;
            lock.unlock();
            WorkerPool::shared().submit([self = shared_from_this()] { self->watchStalls(); });
        }
        return;
    }
    ++active_;
    lock.unlock();
    WorkerPool::shared().submit([self = shared_from_this(), b = std::move(block)]() mutable {
        self->runConcurrent(std::move(b));
    });
}

// Runs on a worker that holds one slot (counted in active_), then keeps taking waiting blocks
// while the queue is within its width.
void DispatchQueue::runConcurrent(std::function<void()> block) {
    BlockingScope::SlotHolder slot(this);
    std::unique_lock lock(mutex_, std::defer_lock);
    for (;;) {
        runBlock(block);
        block = nullptr;
        lock.lock();
        ++finished_;
        if (items_.empty() || active_ > width_) {
            --active_;
            return;
        }
        block = std::move(items_.front().block);
        items_.pop_front();
        lock.unlock();
    }
}

void DispatchQueue::watchStalls() {
    std::unique_lock lock(mutex_);
    uint64_t seen = finished_;
    while (!items_.empty()) {
        stallTick_.wait_for(lock, kStallInterval);
        if (items_.empty())
            break;
        if (finished_ == seen) {
            auto block = std::move(items_.front().block);
            items_.pop_front();
            ++active_;
            lock.unlock();
            WorkerPool::shared().submit(
                [self = shared_from_this(), b = std::move(block)]() mutable {
                    self->runConcurrent(std::move(b));
                });
            lock.lock();
        }
        seen = finished_;
    }
    watching_ = false;
}

// A block of the global queue starts waiting: let a waiting block have its slot.
void DispatchQueue::release() {
    std::unique_lock lock(mutex_);
    --active_;
    if (items_.empty() || active_ >= width_)
        return;
    auto block = std::move(items_.front().block);
    items_.pop_front();
    startConcurrent(lock, std::move(block));
}

// It stops waiting: it runs on, over the width if need be, until its block ends.
void DispatchQueue::reacquire() {
    std::lock_guard lock(mutex_);
    ++active_;
}

}  // namespace tamber
