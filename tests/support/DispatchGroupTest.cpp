#include "support/DispatchGroup.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <stdexcept>
#include <thread>
#include <vector>

#include "support/DispatchSemaphore.h"
#include "support/Log.h"
#include "support/StderrLogSink.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

using namespace std::chrono_literals;

constexpr double kPatience = 10.0;

TEST(DispatchGroupTest, NotifyRunsOnceAfterTheLastLeaveOnItsQueue) {
    DispatchGroup group;
    auto queue = DispatchQueue::makeSerial("test.notify");
    constexpr int kTasks = 3;
    for (int i = 0; i < kTasks; ++i) group.enter();

    std::atomic<int> left{0}, notified{0};
    int leftWhenNotified = -1;
    bool onQueue = false;
    DispatchSemaphore done;
    group.notify(queue, [&] {
        leftWhenNotified = left.load();
        onQueue = queue->isCurrent();
        notified++;
        done.signal();
    });
    std::vector<std::thread> leavers;
    for (int i = 0; i < kTasks; ++i) {
        leavers.emplace_back([&, i] {
            std::this_thread::sleep_for(10ms * (i + 1));
            left++;
            group.leave();
        });
    }
    for (auto& t : leavers) t.join();
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_EQ(leftWhenNotified, kTasks);
    EXPECT_TRUE(onQueue);

    // Emptying the group again does not repeat a notification that already ran.
    group.enter();
    group.leave();
    queue->sync([] {});
    EXPECT_EQ(notified.load(), 1);
}

TEST(DispatchGroupTest, NotifyOnAnEmptyGroupIsSubmittedNotRunInline) {
    DispatchGroup group;
    auto queue = DispatchQueue::makeSerial("test.empty-notify");
    DispatchSemaphore gate, done;
    queue->async([&] { gate.wait(); });
    std::atomic<bool> ran{false};
    bool onQueue = false;
    group.notify(queue, [&] {
        onQueue = queue->isCurrent();
        ran = true;
        done.signal();
    });
    EXPECT_FALSE(ran) << "the queue is still held by the gate";
    gate.signal();
    ASSERT_TRUE(done.wait(kPatience));
    EXPECT_TRUE(onQueue);
}

TEST(DispatchGroupTest, WaitReturnsOnceEveryGroupBlockEndedEvenByThrowing) {
    testing::ScopedLogCapture capture;  // keeps the expected error lines out of the output
    DispatchGroup group;
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
    ASSERT_TRUE(group.wait(kPatience));
    EXPECT_EQ(finished.load(), kBlocks);
    group.wait();  // already empty: returns at once
}

TEST(DispatchGroupTest, WaitTimesOutWhileATaskIsUnfinished) {
    DispatchGroup group;
    group.enter();
    EXPECT_FALSE(group.wait(0.1));
    group.leave();
    EXPECT_TRUE(group.wait(0.0));
}

TEST(DispatchGroupDeathTest, LeaveWithoutEnterIsFatal) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            Log::shared().setSink(std::make_shared<StderrLogSink>());
            DispatchGroup group;
            group.enter();
            group.leave();
            group.leave();
        },
        "leave without a matching enter");
}

}  // namespace
}  // namespace tamber
