#include "support/LogSection.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <map>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "support/Log.h"
#include "support/Result.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

std::string opening(uint64_t n, const std::string& title) {
    return "[DEBUG] ┏" + std::to_string(n) + " " + title;
}
std::string closing(uint64_t n) {
    return "[DEBUG] ┗" + std::to_string(n);
}

// The section lines among everything captured.
std::vector<std::string> sectionLines(testing::ScopedLogCapture& capture) {
    std::vector<std::string> out;
    for (auto& line : capture->texts()) {
        if (line.rfind("[DEBUG] ┏", 0) == 0 || line.rfind("[DEBUG] ┗", 0) == 0) {
            out.push_back(line);
        }
    }
    return out;
}

TEST(LogSectionTest, SectionsAreNumberedInOrderAndBracketTheirWork) {
    testing::ScopedLogCapture capture;
    uint64_t first;
    {
        LogSection section("enumerate items");
        first = section.number();
    }
    std::vector<std::string> duringWork;
    int result = withLogSection("fetch contents", [&] {
        duringWork = sectionLines(capture);
        return withLogSection("read file", [] { return 7; }) * 6;
    });
    EXPECT_EQ(result, 42);
    EXPECT_EQ(duringWork,
              (std::vector<std::string>{opening(first, "enumerate items"), closing(first),
                                        opening(first + 1, "fetch contents")}));
    EXPECT_EQ(
        sectionLines(capture),
        (std::vector<std::string>{
            opening(first, "enumerate items"), closing(first), opening(first + 1, "fetch contents"),
            opening(first + 2, "read file"), closing(first + 2), closing(first + 1)}));
}

TEST(LogSectionTest, FailingWorkStillClosesItsSection) {
    testing::ScopedLogCapture capture;
    uint64_t base = LogSection("probe").number();

    EXPECT_THROW(withLogSection("throwing", []() -> int { throw std::runtime_error("broken"); }),
                 std::runtime_error);
    Result<int> failed =
        withLogSection("erring", []() -> Result<int> { return Error(kPosixErrorDomain, 5); });
    EXPECT_FALSE(failed.ok());

    EXPECT_EQ(sectionLines(capture),
              (std::vector<std::string>{opening(base, "probe"), closing(base),
                                        opening(base + 1, "throwing"), closing(base + 1),
                                        opening(base + 2, "erring"), closing(base + 2)}));
}

TEST(LogSectionTest, NumbersAreTakenEvenWhileDebugLinesAreOff) {
    testing::ScopedLogCapture capture;
    uint64_t base = LogSection("before").number();
    Log::shared().setDebugEnabled(false);
    uint64_t silent = LogSection("silent").number();
    Log::shared().setDebugEnabled(true);
    uint64_t after = LogSection("after").number();

    EXPECT_EQ(silent, base + 1);
    EXPECT_EQ(after, base + 2);
    EXPECT_EQ(sectionLines(capture),
              (std::vector<std::string>{opening(base, "before"), closing(base),
                                        opening(after, "after"), closing(after)}));
}

TEST(LogSectionTest, ConcurrentSectionsGetDistinctConsecutiveNumbers) {
    testing::ScopedLogCapture capture;
    constexpr int kThreads = 8;
    constexpr int kPerThread = 100;
    std::mutex mutex;
    std::vector<uint64_t> numbers;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < kPerThread; ++i) {
                LogSection section("concurrent");
                std::lock_guard lock(mutex);
                numbers.push_back(section.number());
            }
        });
    }
    for (auto& t : threads) t.join();

    std::sort(numbers.begin(), numbers.end());
    ASSERT_EQ(numbers.size(), size_t(kThreads * kPerThread));
    for (size_t i = 1; i < numbers.size(); ++i) ASSERT_EQ(numbers[i], numbers[i - 1] + 1);

    // Every section opened and closed exactly once under its own number.
    std::map<std::string, int> lineCounts;
    for (auto& line : sectionLines(capture)) ++lineCounts[line];
    for (uint64_t n : numbers) {
        EXPECT_EQ(lineCounts[opening(n, "concurrent")], 1) << n;
        EXPECT_EQ(lineCounts[closing(n)], 1) << n;
    }
}

}  // namespace
}  // namespace tamber
