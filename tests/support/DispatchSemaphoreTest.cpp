#include "support/DispatchSemaphore.h"

#include <gtest/gtest.h>

#include <chrono>

namespace tamber {
namespace {

using Clock = std::chrono::steady_clock;

TEST(DispatchSemaphoreTest, WaitTimesOutWithoutASignal) {
    DispatchSemaphore semaphore;
    constexpr double kTimeout = 0.1;
    auto start = Clock::now();
    EXPECT_FALSE(semaphore.wait(kTimeout));
    EXPECT_GE(std::chrono::duration<double>(Clock::now() - start).count(), kTimeout);
}

TEST(DispatchSemaphoreTest, EachSignalLetsExactlyOneWaitThrough) {
    constexpr int kInitial = 1;
    constexpr int kSignals = 2;
    DispatchSemaphore semaphore(kInitial);
    for (int i = 0; i < kSignals; ++i) semaphore.signal();
    for (int i = 0; i < kInitial + kSignals; ++i) EXPECT_TRUE(semaphore.wait(0.0)) << i;
    EXPECT_FALSE(semaphore.wait(0.0));
}

}  // namespace
}  // namespace tamber
