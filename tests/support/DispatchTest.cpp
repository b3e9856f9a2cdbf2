#include "support/DispatchGroup.h"
#include "support/DispatchQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <thread>
#include <utility>
#include <vector>

#include "support/DispatchSemaphore.h"
#include "support/Log.h"
#include "support/StderrLogSink.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// Only a broken queue takes this long; a failure then fails instead of hanging.
constexpr double kPatience = 10.0;

// Each thread submits asyncs and, every few, a sync that must see all of its earlier asyncs.
TEST(DispatchQueueTest, SerialQueueRunsBlocksOneAtATimeInEachSubmittersOrder) {
    auto queue = DispatchQueue::makeSerial("test.order");
    constexpr int kThreads = 4, kPerThread = 400;
    std::vector<int> next(kThreads, 0);  // touched only from blocks
    std::atomic<int> inside{0}, faults{0};
    auto enter = [&] { faults += inside.fetch_add(1) != 0; };
    std::vector<std::thread> submitters;
    for (int t = 0; t < kThreads; ++t) {
        submitters.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; ++i) {
                queue->async([&, t, i] {
                    enter();
                    faults += next[t] != i;
                    next[t] = i + 1;
                    inside--;
                });
                if (i % 4 == 3) {
                    int seen = queue->sync([&, t] {
                        enter();
                        inside--;
                        return next[t];
                    });
                    faults += seen != i + 1;
                }
            }
        });
    }
    for (auto& s : submitters) s.join();
    EXPECT_EQ(queue->sync([&] { return next; }), std::vector<int>(kThreads, kPerThread));
    EXPECT_EQ(faults.load(), 0);
}

TEST(DispatchQueueTest, NestedSyncRunsOnTheCallersThreadAfterEarlierBlocks) {
    auto a = DispatchQueue::makeSerial("test.a");
    auto b = DispatchQueue::makeSerial("test.b");
    auto c = DispatchQueue::makeSerial("test.c");
    // Busy queues make the inner syncs wait their turn rather than take the queue at once.
    std::vector<int> earlier;
    b->async([] { std::this_thread::sleep_for(20ms); });
    c->async([] { std::this_thread::sleep_for(50ms); });
    for (int i = 0; i < 100; ++i) c->async([&, i] { earlier.push_back(i); });

    auto current = [&] {
        return std::vector<bool>{a->isCurrent(), b->isCurrent(), c->isCurrent()};
    };
    std::vector<bool> innermost, afterC;
    size_t seenEarlier = 0;
    std::thread::id outerThread, innerThread;
    DispatchSemaphore done;
    a->async([&] {
        outerThread = std::this_thread::get_id();
        b->sync([&] {
            seenEarlier = c->sync([&] {
                innerThread = std::this_thread::get_id();
                innermost = current();
                return earlier.size();
            });
            afterC = current();
        });
        done.signal();
    });
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_EQ(seenEarlier, 100u);
    EXPECT_EQ(innerThread, outerThread);
    EXPECT_EQ(innermost, (std::vector<bool>{true, true, true}));
    EXPECT_EQ(afterC, (std::vector<bool>{true, true, false}));
    EXPECT_EQ(current(), (std::vector<bool>{false, false, false}));
}

TEST(DispatchQueueTest, BlockWaitingOnSemaphoreDoesNotStallOtherQueues) {
    auto blocked = DispatchQueue::makeSerial("test.blocked");
    auto other = DispatchQueue::makeSerial("test.other");
    DispatchSemaphore gate, finished;
    std::atomic<bool> released{false};
    blocked->async([&] {
        released = gate.wait(kPatience);
        finished.signal();
    });
    // Only another serial queue and then the global queue can open the gate.
    other->async([&] { DispatchQueue::global()->async([&] { gate.signal(); }); });
    ASSERT_TRUE(finished.wait(2 * kPatience));
    EXPECT_TRUE(released);
}

// More global blocks than its width wait for a global block submitted after them, once on a
// dispatch semaphore and once on a plain condition variable the queue cannot see.
TEST(DispatchQueueTest, GlobalBlocksWaitingOnLaterGlobalBlocksDoNotExhaustIt) {
    auto global = DispatchQueue::global();
    const int width = int(global->width());
    for (auto round : {std::pair{false, 3 * width}, std::pair{true, width + 2}}) {
        // Named variables, not a structured binding: the lambdas capture them, which clang
        // before 16 refuses for bindings.
        const bool plain = round.first;
        const int waiters = round.second;
        DispatchSemaphore gate, allDone;
        std::mutex mutex;
        std::condition_variable changed;
        bool open = false;
        std::atomic<int> released{0}, finished{0};
        // `waiters` by value: the opener still tests its loop bound after the last waiter is done.
        for (int i = 0; i < waiters; ++i) {
            global->async([&, plain, waiters] {
                bool ok = false;
                if (plain) {
                    std::unique_lock lock(mutex);
                    ok = changed.wait_for(lock, std::chrono::duration<double>(kPatience),
                                          [&] { return open; });
                } else {
                    ok = gate.wait(kPatience);
                }
                released += ok;
                if (++finished == waiters)
                    allDone.signal();
            });
        }
        global->async([&, plain, waiters] {
            if (plain) {
                std::lock_guard lock(mutex);
                open = true;
                changed.notify_all();
            } else {
                for (int i = 0; i < waiters; ++i) gate.signal();
            }
        });
        ASSERT_TRUE(allDone.wait(2 * kPatience)) << "plain " << plain;
        EXPECT_EQ(released.load(), waiters) << "plain " << plain;
    }
}

TEST(DispatchQueueTest, ReleasedQueueStillRunsItsPendingAndDelayedBlocksInOrder) {
    auto queue = DispatchQueue::makeSerial("test.released");
    std::weak_ptr<DispatchQueue> weak = queue;
    DispatchSemaphore gate, done;
    std::vector<double> ran;  // delays of the delayed blocks as they ran, on the queue only
    int pending = 0;
    queue->async([&] { gate.wait(); });
    for (int i = 0; i < 100; ++i) queue->async([&] { ++pending; });
    auto start = Clock::now();
    for (double delay : {0.3, 0.1, 0.2}) {
        queue->asyncAfter(delay, [&, delay] {
            EXPECT_GE(std::chrono::duration<double>(Clock::now() - start).count(), delay);
            ran.push_back(delay);
            if (ran.size() == 3)
                done.signal();
        });
    }
    queue.reset();
    EXPECT_FALSE(weak.expired()) << "pending blocks keep their queue";
    gate.signal();
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_EQ(pending, 100);
    EXPECT_EQ(ran, (std::vector<double>{0.1, 0.2, 0.3}));

    auto deadline = Clock::now() + std::chrono::duration<double>(kPatience);
    while (!weak.expired() && Clock::now() < deadline) std::this_thread::sleep_for(1ms);
    EXPECT_TRUE(weak.expired()) << "the queue goes once its last block ran";
}

TEST(DispatchQueueTest, ExceptionsAreLoggedForAsyncAndPropagatedBySync) {
    testing::ScopedLogCapture capture;
    auto queue = DispatchQueue::makeSerial("test.throwing");
    DispatchSemaphore after;
    queue->async([] { throw std::runtime_error("async boom"); });
    queue->async([&] { after.signal(); });
    ASSERT_TRUE(after.wait(kPatience)) << "the queue goes on after a throwing block";
    bool logged = false;
    for (const auto& line : capture->texts())
        logged |= line.rfind("[ERROR] ", 0) == 0 && line.find("async boom") != std::string::npos;
    EXPECT_TRUE(logged);

    EXPECT_THROW(queue->sync([]() -> int { throw std::runtime_error("sync boom"); }),
                 std::runtime_error);
    queue->async([&] { after.signal(); });
    EXPECT_TRUE(after.wait(kPatience)) << "the throwing sync gave the queue back";
}

TEST(DispatchSemaphoreTest, EachSignalLetsExactlyOneWaitThroughAndWaitsTimeOut) {
    DispatchSemaphore semaphore(1);
    semaphore.signal();
    semaphore.signal();
    for (int i = 0; i < 3; ++i) EXPECT_TRUE(semaphore.wait(0.0)) << i;
    auto start = Clock::now();
    EXPECT_FALSE(semaphore.wait(0.1));
    EXPECT_GE(Clock::now() - start, 100ms);
}

TEST(DispatchGroupTest, NotifyRunsOnceOnItsQueueAfterTheLastLeave) {
    DispatchGroup group;
    auto queue = DispatchQueue::makeSerial("test.notify");
    std::atomic<int> notified{0};
    std::atomic<bool> onQueue{false};
    DispatchSemaphore done, gate;
    auto notification = [&] {
        onQueue = queue->isCurrent();
        notified++;
        done.signal();
    };
    for (int i = 0; i < 3; ++i) group.enter();
    group.notify(queue, notification);
    group.leave();
    group.leave();
    queue->sync([] {});
    EXPECT_EQ(notified.load(), 0);
    group.leave();
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_TRUE(onQueue);
    // Emptying the group again does not repeat a notification that already ran.
    group.enter();
    group.leave();
    queue->sync([] {});
    EXPECT_EQ(notified.load(), 1);

    // On an empty group the notification is submitted, not run inline.
    queue->async([&] { gate.wait(); });
    onQueue = false;
    group.notify(queue, notification);
    EXPECT_EQ(notified.load(), 1) << "the queue is still held by the gate";
    gate.signal();
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_TRUE(onQueue);
}

TEST(DispatchGroupTest, WaitTimesOutUntilEveryBlockEndedEvenByThrowing) {
    testing::ScopedLogCapture capture;  // keeps the expected error lines out of the output
    DispatchGroup group;
    group.enter();
    EXPECT_FALSE(group.wait(0.1));
    constexpr int kBlocks = 50;
    std::atomic<int> finished{0};
    for (int i = 0; i < kBlocks; ++i) {
        group.async(DispatchQueue::global(), [&, i] {
            std::this_thread::sleep_for(1ms);
            finished++;
            if (i % 10 == 0)
                throw std::runtime_error("group block failed");
        });
    }
    group.leave();
    ASSERT_TRUE(group.wait(kPatience));
    EXPECT_EQ(finished.load(), kBlocks);
    EXPECT_TRUE(group.wait(0.0));
}

TEST(DispatchDeathTest, SyncOntoACurrentQueueWrongAssertionsAndUnmatchedLeaveAreFatal) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    // The fatal line must reach standard error whatever sink the process picked.
    auto toStderr = [] { Log::shared().setSink(std::make_shared<StderrLogSink>()); };
    auto queue = DispatchQueue::makeSerial("test.self");
    auto other = DispatchQueue::makeSerial("test.middle");
    EXPECT_DEATH((toStderr(), queue->sync([&] { other->sync([&] { queue->sync([] {}); }); })),
                 "sync onto queue test.self");
    queue->assertNotCurrent();
    queue->sync([&] { queue->assertCurrent(); });
    EXPECT_DEATH((toStderr(), queue->assertCurrent()), "expected to run on queue test.self");
    EXPECT_DEATH((toStderr(), queue->sync([&] { queue->assertNotCurrent(); })),
                 "expected not to run on queue test.self");
    DispatchGroup group;
    EXPECT_DEATH((toStderr(), group.enter(), group.leave(), group.leave()),
                 "leave without a matching enter");
}

}  // namespace
}  // namespace tamber
