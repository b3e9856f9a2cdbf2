#include "support/Pacer.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "support/DispatchSemaphore.h"

namespace tamber {
namespace {

using PacerClock = std::chrono::steady_clock;
using namespace std::chrono_literals;

constexpr double kInterval = 0.2;
constexpr double kPacerPatience = 10.0;

template <class D>
double seconds(D d) {
    return std::chrono::duration<double>(d).count();
}

// Records every start of the handler, which must run on the pacer's queue.
struct Runs {
    std::function<void()> handler(std::shared_ptr<DispatchQueue> queue,
                                  std::function<void()> during = {}) {
        return [this, queue, during] {
            EXPECT_TRUE(queue->isCurrent());
            {
                std::lock_guard lock(mutex);
                starts.push_back(PacerClock::now());
            }
            started.signal();
            if (during)
                during();
        };
    }
    bool wait(double timeout = kPacerPatience) { return started.wait(timeout); }
    std::vector<PacerClock::time_point> all() {
        std::lock_guard lock(mutex);
        return starts;
    }
    std::mutex mutex;
    std::vector<PacerClock::time_point> starts;
    DispatchSemaphore started;
};

TEST(PacerTest, BurstGivesOneRunAfterTheIntervalAndASignalDuringARunExactlyOneMore) {
    auto queue = DispatchQueue::makeSerial("test.pacer");
    Runs runs;
    DispatchSemaphore release;
    std::atomic<bool> hold{false};
    Pacer pacer("burst", queue, kInterval);
    pacer.setEventHandler(runs.handler(queue, [&] {
        if (hold.exchange(false))
            release.wait(kPacerPatience);
    }));

    auto firstSignal = PacerClock::now();
    for (int i = 0; i < 10; ++i) {
        pacer.signal();
        std::this_thread::sleep_for(5ms);
    }
    ASSERT_TRUE(runs.wait());
    EXPECT_FALSE(runs.wait(3 * kInterval)) << "no further run without a further signal";
    ASSERT_EQ(runs.all().size(), 1u);
    EXPECT_GE(seconds(runs.all()[0] - firstSignal), kInterval);

    hold = true;
    pacer.signal();
    ASSERT_TRUE(runs.wait());
    auto signalledDuringRun = PacerClock::now();
    for (int i = 0; i < 3; ++i) pacer.signal();
    release.signal();
    ASSERT_TRUE(runs.wait()) << "the signal during the run was lost";
    EXPECT_FALSE(runs.wait(3 * kInterval)) << "one more run serves all those signals";
    auto starts = runs.all();
    ASSERT_EQ(starts.size(), 3u);
    EXPECT_GE(seconds(starts[2] - starts[1]), kInterval);
    EXPECT_GE(seconds(starts[2] - signalledDuringRun), kInterval);
}

TEST(PacerTest, SteadySignalsFromManyThreadsRunAtMostOncePerIntervalAndLoseNone) {
    constexpr double kShortInterval = 0.1;
    auto queue = DispatchQueue::global();
    Runs runs;
    Pacer pacer("steady", queue, kShortInterval);
    pacer.setEventHandler(runs.handler(queue));

    std::atomic<bool> stop{false};
    std::vector<PacerClock::time_point> lastSignal(3);
    std::vector<std::thread> signallers;
    for (size_t t = 0; t < lastSignal.size(); ++t) {
        signallers.emplace_back([&, t] {
            while (!stop) {
                lastSignal[t] = PacerClock::now();  // taken before the signal it stands for
                pacer.signal();
                std::this_thread::sleep_for(1ms);
            }
        });
    }
    std::this_thread::sleep_for(1s);
    stop = true;
    for (auto& s : signallers) s.join();
    auto stormEnd = PacerClock::now();
    auto last = *std::max_element(lastSignal.begin(), lastSignal.end());

    // Wait for the run that serves the last signal.
    auto deadline = PacerClock::now() + std::chrono::duration<double>(kPacerPatience);
    while ((runs.all().empty() || runs.all().back() <= last) &&
           runs.wait(std::max(0.0, seconds(deadline - PacerClock::now())))) {
    }
    auto starts = runs.all();
    ASSERT_FALSE(starts.empty());
    EXPECT_GT(starts.back(), last) << "the last signal was never served";
    EXPECT_GE(std::count_if(starts.begin(), starts.end(), [&](auto s) { return s < stormEnd; }), 2)
        << "steady signals must not postpone the runs indefinitely";
    for (size_t i = 1; i < starts.size(); ++i)
        EXPECT_GE(seconds(starts[i] - starts[i - 1]), kShortInterval) << "runs " << i;
}

TEST(PacerTest, DestroyingThePacerCancelsAPendingRunAndWaitsForOneUnderWay) {
    auto queue = DispatchQueue::makeSerial("test.pacer-cancel");
    Runs cancelled, busy;
    {
        Pacer pacer("cancelled", queue, kInterval);
        pacer.setEventHandler(cancelled.handler(queue));
        pacer.signal();
    }
    EXPECT_FALSE(cancelled.wait(3 * kInterval));

    std::atomic<bool> runFinished{false};
    {
        Pacer pacer("busy", queue, 0.0);
        pacer.setEventHandler(busy.handler(queue, [&] {
            std::this_thread::sleep_for(100ms);
            runFinished = true;
        }));
        pacer.signal();
        ASSERT_TRUE(busy.wait());
    }
    EXPECT_TRUE(runFinished);
}

}  // namespace
}  // namespace tamber
