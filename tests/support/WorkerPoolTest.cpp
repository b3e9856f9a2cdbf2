#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <vector>

#include "support/DispatchQueue.h"
#include "support/DispatchSemaphore.h"
#include "support/DispatchTimer.h"
#include "support/WorkerPool.h"
#include "tests/common/ThreadCount.h"

namespace tamber {
namespace {

using testing::liveThreadCount;

constexpr double kPoolPatience = 20;  // seconds: only a hang gets near it

// Leaves the pool and the timer without threads, whatever earlier tests left running.
void settle() {
    DispatchTimer::shared().shutdown();
    WorkerPool::shared().shutdown();
}

// More blocked tasks than the bound: the pool never runs more threads than that, the tasks
// beyond it wait their turn instead of being lost, and all of them run once the gate opens.
TEST(WorkerPoolTest, TasksBeyondTheBoundWaitForAFreeWorkerAndAllRun) {
    settle();
    WorkerPool& pool = WorkerPool::shared();
    const size_t tasks = WorkerPool::kMaxThreads + 40;
    DispatchSemaphore gate, allStarted, allDone;
    std::atomic<size_t> started{0}, done{0};
    std::atomic<size_t> mostAlive{0};
    for (size_t i = 0; i < tasks; ++i) {
        pool.submit([&] {
            size_t alive = pool.threadCount();
            size_t seen = mostAlive.load();
            while (alive > seen && !mostAlive.compare_exchange_weak(seen, alive)) {
            }
            if (++started == WorkerPool::kMaxThreads)
                allStarted.signal();
            gate.wait(kPoolPatience);
            if (++done == tasks)
                allDone.signal();
        });
    }
    ASSERT_TRUE(allStarted.wait(kPoolPatience));
    EXPECT_EQ(started.load(), WorkerPool::kMaxThreads);  // the rest are queued, not running
    EXPECT_LE(pool.threadCount(), WorkerPool::kMaxThreads);
    for (size_t i = 0; i < tasks; ++i) gate.signal();
    ASSERT_TRUE(allDone.wait(kPoolPatience));
    EXPECT_EQ(started.load(), tasks);
    EXPECT_LE(mostAlive.load(), WorkerPool::kMaxThreads);
    settle();
}

// shutdown() returns only after the tasks that tasks submit have run too, and then no worker
// thread is left; the pool serves again afterwards.
TEST(WorkerPoolTest, ShutdownDrainsChainedTasksJoinsEveryWorkerAndThePoolServesAgain) {
    settle();
    const size_t before = liveThreadCount();
    WorkerPool& pool = WorkerPool::shared();
    std::atomic<int> ran{0};
    std::function<void(int)> chain = [&](int left) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
        ++ran;
        if (left > 0)
            pool.submit([&chain, left] { chain(left - 1); });
    };
    for (int i = 0; i < 8; ++i) pool.submit([&chain] { chain(9); });
    pool.shutdown();
    EXPECT_EQ(ran.load(), 80);
    EXPECT_EQ(pool.threadCount(), 0u);
    EXPECT_LE(liveThreadCount(), before + testing::kSanitizerThreads);

    DispatchSemaphore again;
    pool.submit([&] { again.signal(); });
    EXPECT_TRUE(again.wait(kPoolPatience));
    pool.shutdown();
    EXPECT_LE(liveThreadCount(), before + testing::kSanitizerThreads);
}

// Serial queues hand work on through the pool: draining the pool finishes a queue's backlog
// in order rather than dropping what was queued behind the running block.
TEST(WorkerPoolTest, ShutdownFinishesEveryQueuedBlockOfASerialQueueInOrder) {
    settle();
    auto queue = DispatchQueue::makeSerial("test.drained");
    std::vector<int> order;
    for (int i = 0; i < 50; ++i) queue->async([&order, i] { order.push_back(i); });
    WorkerPool::shared().shutdown();
    ASSERT_EQ(order.size(), 50u);
    for (int i = 0; i < 50; ++i) EXPECT_EQ(order[i], i);
}

// Delayed work that is not due when the timer shuts down is dropped with what it captured,
// its thread is joined, and work scheduled afterwards still fires.
TEST(DispatchTimerTest, ShutdownDropsPendingWorkReleasesItsCapturesAndTheTimerStartsAgain) {
    settle();
    const size_t before = liveThreadCount();
    auto captured = std::make_shared<int>(1);
    std::weak_ptr<int> weak = captured;
    std::atomic<bool> fired{false};
    DispatchTimer::shared().schedule(DispatchTimer::deadlineAfter(3600),
                                     [&fired, c = std::move(captured)] { fired = true; });
    DispatchTimer::shared().shutdown();
    EXPECT_TRUE(weak.expired());
    EXPECT_FALSE(fired);
    EXPECT_LE(liveThreadCount(), before + testing::kSanitizerThreads);

    DispatchSemaphore soon;
    DispatchTimer::shared().schedule(DispatchTimer::deadlineAfter(0.01), [&] { soon.signal(); });
    EXPECT_TRUE(soon.wait(kPoolPatience));
    DispatchTimer::shared().shutdown();
    EXPECT_LE(liveThreadCount(), before + testing::kSanitizerThreads);
}

}  // namespace
}  // namespace tamber
