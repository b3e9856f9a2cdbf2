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

double secondsSince(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

TEST(DispatchQueueTest, SerialQueueRunsBlocksOneAtATimeInSubmissionOrder) {
    auto queue = DispatchQueue::makeSerial("test.order");
    constexpr int kThreads = 4;
    constexpr int kPerThread = 500;
    // Touched only from blocks: ThreadSanitizer reports any two blocks that overlap.
    std::vector<std::pair<int, int>> ran;
    std::atomic<int> inside{0};
    std::atomic<bool> overlapped{false};
    DispatchSemaphore done;

    std::vector<std::thread> submitters;
    for (int t = 0; t < kThreads; ++t) {
        submitters.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; ++i) {
                queue->async([&, t, i] {
                    if (inside.fetch_add(1) != 0)
                        overlapped = true;
                    ran.emplace_back(t, i);
                    inside.fetch_sub(1);
                    if (ran.size() == kThreads * kPerThread)
                        done.signal();
                });
            }
        });
    }
    for (auto& s : submitters) s.join();
    ASSERT_TRUE(done.wait(kPatience));

    EXPECT_FALSE(overlapped);
    std::vector<int> next(kThreads, 0);
    for (auto [t, i] : ran) {
        ASSERT_EQ(i, next[t]) << "thread " << t << " submitted its blocks in order";
        next[t] = i + 1;
    }
}

TEST(DispatchQueueTest, SyncFromAnotherQueueWaitsForEarlierBlocksAndReturnsTheResult) {
    auto queue = DispatchQueue::makeSerial("test.target");
    auto caller = DispatchQueue::makeSerial("test.caller");
    constexpr int kEarlier = 100;
    std::vector<int> seen;
    queue->async([] { std::this_thread::sleep_for(50ms); });  // keeps the queue busy meanwhile
    for (int i = 0; i < kEarlier; ++i) queue->async([&, i] { seen.push_back(i); });

    DispatchSemaphore done;
    size_t observed = 0;
    std::thread::id callerThread, blockThread;
    caller->async([&] {
        callerThread = std::this_thread::get_id();
        observed = queue->sync([&] {
            blockThread = std::this_thread::get_id();
            return seen.size();
        });
        done.signal();
    });
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_EQ(observed, size_t(kEarlier));
    EXPECT_EQ(blockThread, callerThread) << "the sync block runs on the caller's thread";

    // Move-only results and references come back too.
    auto last = queue->sync([&] { return std::make_unique<int>(seen.back()); });
    EXPECT_EQ(*last, kEarlier - 1);
    int& first = queue->sync([&]() -> int& { return seen.front(); });
    EXPECT_EQ(&first, &seen.front());
}

TEST(DispatchQueueTest, SyncAndAsyncFromManyThreadsKeepEachThreadsOrder) {
    auto queue = DispatchQueue::makeSerial("test.mixed");
    constexpr int kThreads = 4;
    constexpr int kRounds = 200;
    std::vector<int> applied(kThreads, 0);  // only touched on the queue
    std::atomic<int> inside{0};
    std::atomic<int> mismatches{0};

    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            for (int round = 1; round <= kRounds; ++round) {
                queue->async([&, t] {
                    if (inside.fetch_add(1) != 0)
                        mismatches++;
                    ++applied[t];
                    inside.fetch_sub(1);
                });
                // The sync must come after this thread's async above.
                int now = queue->sync([&, t] {
                    if (inside.fetch_add(1) != 0)
                        mismatches++;
                    inside.fetch_sub(1);
                    return applied[t];
                });
                if (now != round)
                    mismatches++;
            }
        });
    }
    for (auto& t : threads) t.join();
    EXPECT_EQ(mismatches.load(), 0);
}

TEST(DispatchQueueTest, NestedSyncMakesEveryQueueOfTheChainCurrent) {
    auto a = DispatchQueue::makeSerial("test.a");
    auto b = DispatchQueue::makeSerial("test.b");
    auto c = DispatchQueue::makeSerial("test.c");
    auto unrelated = DispatchQueue::makeSerial("test.unrelated");
    // Busy queues make the inner syncs wait their turn rather than take the queue at once.
    b->async([] { std::this_thread::sleep_for(20ms); });
    c->async([] { std::this_thread::sleep_for(20ms); });

    struct Seen {
        bool a = false, b = false, c = false, unrelated = true;
    } innermost, afterC;
    std::thread::id outerThread, innerThread;
    DispatchSemaphore done;
    a->async([&] {
        outerThread = std::this_thread::get_id();
        b->sync([&] {
            c->sync([&] {
                innerThread = std::this_thread::get_id();
                innermost = {a->isCurrent(), b->isCurrent(), c->isCurrent(),
                             unrelated->isCurrent()};
            });
            afterC = {a->isCurrent(), b->isCurrent(), c->isCurrent(), unrelated->isCurrent()};
        });
        done.signal();
    });
    ASSERT_TRUE(done.wait(kPatience));

    EXPECT_TRUE(innermost.a && innermost.b && innermost.c);
    EXPECT_FALSE(innermost.unrelated);
    EXPECT_TRUE(afterC.a && afterC.b);
    EXPECT_FALSE(afterC.c);
    EXPECT_EQ(innerThread, outerThread);
    EXPECT_FALSE(a->isCurrent() || b->isCurrent() || c->isCurrent());
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

TEST(DispatchQueueTest, GlobalBlocksWaitingOnLaterGlobalBlocksDoNotExhaustIt) {
    auto global = DispatchQueue::global();
    const int waiters = int(3 * global->width());
    DispatchSemaphore gate, allDone;
    std::atomic<int> released{0}, finished{0};
    // `waiters` by value: the opener still tests its loop bound after the last waiter is done.
    for (int i = 0; i < waiters; ++i) {
        global->async([&, waiters] {
            if (gate.wait(kPatience))
                released++;
            if (++finished == waiters)
                allDone.signal();
        });
    }
    global->async([&, waiters] {
        for (int i = 0; i < waiters; ++i) gate.signal();
    });
    ASSERT_TRUE(allDone.wait(2 * kPatience));
    EXPECT_EQ(released.load(), waiters);
}

TEST(DispatchQueueTest, GlobalQueueProgressesWhenBlocksWaitOutsideDispatchPrimitives) {
    auto global = DispatchQueue::global();
    // More blockers than the queue's width, waiting on a plain condition variable that only
    // the block submitted after them opens.
    const int waiters = int(global->width()) + 2;
    std::mutex mutex;
    std::condition_variable changed;
    bool open = false;
    int released = 0, finished = 0;
    for (int i = 0; i < waiters; ++i) {
        global->async([&] {
            std::unique_lock lock(mutex);
            if (changed.wait_for(lock, std::chrono::duration<double>(kPatience),
                                 [&] { return open; }))
                ++released;
            ++finished;
            changed.notify_all();
        });
    }
    global->async([&] {
        std::lock_guard lock(mutex);
        open = true;
        changed.notify_all();
    });
    std::unique_lock lock(mutex);
    changed.wait_for(lock, std::chrono::duration<double>(2 * kPatience),
                     [&] { return finished == waiters; });
    EXPECT_EQ(finished, waiters);
    EXPECT_EQ(released, waiters);
}

TEST(DispatchQueueTest, ReleasedQueueStillRunsItsPendingBlocks) {
    auto queue = DispatchQueue::makeSerial("test.released");
    std::weak_ptr<DispatchQueue> weak = queue;
    DispatchSemaphore gate, done;
    constexpr int kBlocks = 100;
    int ran = 0;
    queue->async([&] { gate.wait(); });
    for (int i = 0; i < kBlocks; ++i) {
        queue->async([&] {
            if (++ran == kBlocks)
                done.signal();
        });
    }
    queue.reset();
    EXPECT_FALSE(weak.expired()) << "pending blocks keep their queue";
    gate.signal();
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_EQ(ran, kBlocks);

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
    for (const auto& line : capture->texts()) {
        logged |= line.rfind("[ERROR] ", 0) == 0 && line.find("async boom") != std::string::npos;
    }
    EXPECT_TRUE(logged);

    EXPECT_THROW(queue->sync([]() -> int { throw std::runtime_error("sync boom"); }),
                 std::runtime_error);
    // The throwing sync must have given the queue back.
    queue->async([&] { after.signal(); });
    EXPECT_TRUE(after.wait(kPatience));
}

TEST(DispatchQueueTest, AsyncAfterRunsNoEarlierThanAskedInDeadlineOrder) {
    auto queue = DispatchQueue::makeSerial("test.later");
    const std::vector<double> delays = {0.3, 0.1, 0.2};
    std::vector<std::pair<double, double>> ran;  // (asked delay, elapsed), on the queue only
    DispatchSemaphore done;
    auto start = Clock::now();
    for (double delay : delays) {
        queue->asyncAfter(delay, [&, delay] {
            ran.emplace_back(delay, secondsSince(start));
            if (ran.size() == 3)
                done.signal();
        });
    }
    queue.reset();  // delayed blocks keep the queue too
    ASSERT_TRUE(done.wait(kPatience));
    for (size_t i = 0; i < ran.size(); ++i) {
        EXPECT_GE(ran[i].second, ran[i].first);
        if (i > 0) {
            EXPECT_LT(ran[i - 1].first, ran[i].first);
        }
    }
}

class DispatchQueueDeathTest : public ::testing::Test {
protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
    // The fatal line must reach standard error whatever sink the process picked.
    static void logToStderr() { Log::shared().setSink(std::make_shared<StderrLogSink>()); }
};

TEST_F(DispatchQueueDeathTest, SyncOntoACurrentQueueAndWrongAssertionsAreFatal) {
    auto queue = DispatchQueue::makeSerial("test.self");
    auto other = DispatchQueue::makeSerial("test.middle");
    EXPECT_DEATH(
        {
            logToStderr();
            queue->sync([&] { other->sync([&] { queue->sync([] {}); }); });
        },
        "sync onto queue test.self");

    queue->assertNotCurrent();
    queue->sync([&] { queue->assertCurrent(); });
    EXPECT_DEATH(
        {
            logToStderr();
            queue->assertCurrent();
        },
        "expected to run on queue test.self");
    EXPECT_DEATH(
        {
            logToStderr();
            queue->sync([&] { queue->assertNotCurrent(); });
        },
        "expected not to run on queue test.self");
}

}  // namespace
}  // namespace tamber
