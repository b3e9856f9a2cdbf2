#include "support/Pacer.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

#include "support/DispatchSemaphore.h"

namespace tamber {
namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

constexpr double kInterval = 0.2;
constexpr double kPatience = 10.0;

template <class D>
double seconds(D d) {
    return std::chrono::duration<double>(d).count();
}

// Records every start of the handler.
class Runs {
public:
    explicit Runs(std::shared_ptr<DispatchQueue> queue) : queue_(std::move(queue)) {}

    std::function<void()> handler(std::function<void()> during = {}) {
        return [this, during] {
            {
                std::lock_guard lock(mutex_);
                starts_.push_back(Clock::now());
                if (!queue_->isCurrent())
                    offQueue_ = true;
            }
            started_.signal();
            if (during)
                during();
        };
    }

    bool waitForRun(double timeout = kPatience) { return started_.wait(timeout); }
    std::vector<Clock::time_point> starts() const {
        std::lock_guard lock(mutex_);
        return starts_;
    }
    bool offQueue() const {
        std::lock_guard lock(mutex_);
        return offQueue_;
    }

private:
    std::shared_ptr<DispatchQueue> queue_;
    mutable std::mutex mutex_;
    std::vector<Clock::time_point> starts_;
    bool offQueue_ = false;
    DispatchSemaphore started_;
};

TEST(PacerTest, BurstOfSignalsGivesOneRunOnTheQueueAfterTheInterval) {
    auto queue = DispatchQueue::makeSerial("test.pacer");
    Runs runs(queue);
    Pacer pacer("burst", queue, kInterval);
    pacer.setEventHandler(runs.handler());

    auto firstSignal = Clock::now();
    for (int i = 0; i < 10; ++i) {
        pacer.signal();
        std::this_thread::sleep_for(5ms);
    }
    ASSERT_TRUE(runs.waitForRun());
    EXPECT_FALSE(runs.waitForRun(3 * kInterval)) << "no further run without a further signal";

    auto starts = runs.starts();
    ASSERT_EQ(starts.size(), 1u);
    EXPECT_GE(seconds(starts[0] - firstSignal), kInterval);
    EXPECT_FALSE(runs.offQueue());
}

TEST(PacerTest, NothingRunsWithoutASignal) {
    auto queue = DispatchQueue::makeSerial("test.pacer-idle");
    Runs runs(queue);
    Pacer pacer("idle", queue, kInterval);
    pacer.setEventHandler(runs.handler());
    EXPECT_FALSE(runs.waitForRun(3 * kInterval));
}

TEST(PacerTest, SignalDuringARunCausesExactlyOneMoreRunAnIntervalLater) {
    auto queue = DispatchQueue::makeSerial("test.pacer-rerun");
    Runs runs(queue);
    DispatchSemaphore release;
    std::atomic<bool> first{true};
    Pacer pacer("rerun", queue, kInterval);
    pacer.setEventHandler(runs.handler([&] {
        if (first.exchange(false))
            release.wait(kPatience);
    }));

    pacer.signal();
    ASSERT_TRUE(runs.waitForRun());
    auto signalledDuringRun = Clock::now();
    for (int i = 0; i < 3; ++i) pacer.signal();
    release.signal();

    ASSERT_TRUE(runs.waitForRun()) << "the signal during the run was lost";
    EXPECT_FALSE(runs.waitForRun(3 * kInterval)) << "one more run serves all those signals";
    auto starts = runs.starts();
    ASSERT_EQ(starts.size(), 2u);
    EXPECT_GE(seconds(starts[1] - starts[0]), kInterval);
    EXPECT_GE(seconds(starts[1] - signalledDuringRun), kInterval);
}

TEST(PacerTest, SteadySignalsFromManyThreadsRunAtMostOncePerIntervalAndLoseNone) {
    constexpr double kShortInterval = 0.1;
    auto queue = DispatchQueue::global();
    Runs runs(queue);
    Pacer pacer("steady", queue, kShortInterval);
    pacer.setEventHandler(runs.handler());

    constexpr auto kStorm = 1s;
    std::atomic<bool> stop{false};
    std::vector<Clock::time_point> lastSignal(3);
    std::vector<std::thread> signallers;
    for (size_t t = 0; t < lastSignal.size(); ++t) {
        signallers.emplace_back([&, t] {
            while (!stop) {
                lastSignal[t] = Clock::now();  // taken before the signal it stands for
                pacer.signal();
                std::this_thread::sleep_for(1ms);
            }
        });
    }
    std::this_thread::sleep_for(kStorm);
    stop = true;
    for (auto& s : signallers) s.join();
    auto stormEnd = Clock::now();
    auto last = *std::max_element(lastSignal.begin(), lastSignal.end());

    // Wait for the run that serves the last signal.
    auto deadline = Clock::now() + std::chrono::duration<double>(kPatience);
    std::vector<Clock::time_point> starts;
    do {
        starts = runs.starts();
        if (!starts.empty() && starts.back() > last)
            break;
    } while (runs.waitForRun(std::max(0.0, seconds(deadline - Clock::now()))));

    ASSERT_FALSE(starts.empty());
    EXPECT_GT(starts.back(), last) << "the last signal was never served";
    EXPECT_GE(std::count_if(starts.begin(), starts.end(), [&](auto s) { return s < stormEnd; }), 2)
        << "steady signals must not postpone the runs indefinitely";
    for (size_t i = 1; i < starts.size(); ++i) {
        EXPECT_GE(seconds(starts[i] - starts[i - 1]), kShortInterval) << "runs " << i;
    }
}

TEST(PacerTest, DestroyingThePacerCancelsItsPendingRun) {
    auto queue = DispatchQueue::makeSerial("test.pacer-cancel");
    Runs runs(queue);
    {
        Pacer pacer("cancelled", queue, kInterval);
        pacer.setEventHandler(runs.handler());
        pacer.signal();
    }
    EXPECT_FALSE(runs.waitForRun(3 * kInterval));
    EXPECT_TRUE(runs.starts().empty());
}

TEST(PacerTest, DestroyingThePacerWaitsForARunUnderWay) {
    auto queue = DispatchQueue::makeSerial("test.pacer-busy");
    Runs runs(queue);
    std::atomic<bool> runFinished{false};
    {
        Pacer pacer("busy", queue, 0.0);
        pacer.setEventHandler(runs.handler([&] {
            std::this_thread::sleep_for(100ms);
            runFinished = true;
        }));
        pacer.signal();
        ASSERT_TRUE(runs.waitForRun());
    }
    EXPECT_TRUE(runFinished);
}

}  // namespace
}  // namespace tamber
