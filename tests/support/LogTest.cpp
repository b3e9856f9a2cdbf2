#include "support/Log.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "support/LogSection.h"
#include "support/Result.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

using testing::ScopedLogCapture;
using Lines = std::vector<std::string>;

TEST(LogTest, ThreeFormatsAndTheirLevelsAndFormattedLinesWithoutPrefix) {
    ScopedLogCapture log;
    logDebug("found fid=2");
    logInfo("notify changes");
    logError("can't open");
    logFormat(LogLevel::Info, "can't resolve path matching file ID \"%lld\"; %{errno}d",
              {int64_t{12}, ErrnoArg{ESTALE}});
    EXPECT_EQ(log->texts(),
              (Lines{"[DEBUG] found fid=2", "[INFO] notify changes", "[ERROR] can't open",
                     "can't resolve path matching file ID \"12\"; [" + std::to_string(ESTALE) +
                         ": " + std::strerror(ESTALE) + "]"}));
    std::vector<LogLevel> levels;
    for (const auto& line : log->lines()) levels.push_back(line.level);
    EXPECT_EQ(levels, (std::vector<LogLevel>{LogLevel::Debug, LogLevel::Info, LogLevel::Error,
                                             LogLevel::Info}));
}

TEST(LogTest, DebugLinesAreNotEvenBuiltWhenDebugIsOff) {
    ScopedLogCapture log;
    int built = 0;
    auto expensive = [&] {
        ++built;
        return std::string("expensive");
    };
    Log::shared().setDebugEnabled(false);
    logDebug(expensive);
    logDebug("plain");
    logFormat(LogLevel::Debug, "%@", {std::string("x")});
    logError("still written");
    EXPECT_EQ(built, 0);
    EXPECT_EQ(log->texts(), Lines{"[ERROR] still written"});
    Log::shared().setDebugEnabled(true);
    logDebug(expensive);
    EXPECT_EQ(built, 1);
    EXPECT_TRUE(log->contains("[DEBUG] expensive"));
}

TEST(LogTest, PlatformPlaceholders) {
    EXPECT_EQ(formatPlatform("invalid identifier; identifier should have 2 components, not %lu",
                             {uint64_t{3}}),
              "invalid identifier; identifier should have 2 components, not 3");
    EXPECT_EQ(
        formatPlatform("can't resolve doc ID \"%lld\"; %{errno}d", {int64_t{-7}, ErrnoArg{ENOENT}}),
        std::string("can't resolve doc ID \"-7\"; [2: ") + std::strerror(ENOENT) + "]");
    EXPECT_EQ(formatPlatform("doc ID resolution failed with errno(%d), 100%%", {int64_t{35}}),
              "doc ID resolution failed with errno(35), 100%");
    EXPECT_EQ(formatPlatform("\"%@\" is not part of Tamber", {std::string("/a b")}),
              "\"/a b\" is not part of Tamber");
    // Missing arguments leave nothing behind rather than reading past the list.
    EXPECT_EQ(formatPlatform("a %@ b %lu", {std::string("x")}), "a x b ");
    // An unknown directive is kept as text.
    EXPECT_EQ(formatPlatform("%q %", {}), "%q %");
}

std::string opening(uint64_t n, const std::string& title) {
    return "[DEBUG] ┏" + std::to_string(n) + " " + title;
}
std::string closing(uint64_t n) {
    return "[DEBUG] ┗" + std::to_string(n);
}

// The section lines among everything captured.
Lines sectionLines(ScopedLogCapture& capture) {
    Lines out;
    for (auto& line : capture->texts()) {
        if (line.rfind("[DEBUG] ┏", 0) == 0 || line.rfind("[DEBUG] ┗", 0) == 0)
            out.push_back(line);
    }
    return out;
}

TEST(LogSectionTest, SectionsAreNumberedInOrderAndCloseHoweverTheirWorkEnds) {
    ScopedLogCapture capture;
    uint64_t n = LogSection("enumerate items").number();
    Lines duringWork;
    int result = withLogSection("fetch contents", [&] {
        duringWork = sectionLines(capture);
        return withLogSection("read file", [] { return 7; }) * 6;
    });
    EXPECT_EQ(result, 42);
    EXPECT_EQ(duringWork,
              (Lines{opening(n, "enumerate items"), closing(n), opening(n + 1, "fetch contents")}));

    EXPECT_THROW(withLogSection("throwing", []() -> int { throw std::runtime_error("broken"); }),
                 std::runtime_error);
    Result<int> failed =
        withLogSection("erring", []() -> Result<int> { return Error(kPosixErrorDomain, 5); });
    EXPECT_FALSE(failed.ok());
    // A section opened while debug lines are off still takes its number.
    Log::shared().setDebugEnabled(false);
    EXPECT_EQ(LogSection("silent").number(), n + 5);
    Log::shared().setDebugEnabled(true);
    EXPECT_EQ(LogSection("after").number(), n + 6);

    EXPECT_EQ(sectionLines(capture),
              (Lines{opening(n, "enumerate items"), closing(n), opening(n + 1, "fetch contents"),
                     opening(n + 2, "read file"), closing(n + 2), closing(n + 1),
                     opening(n + 3, "throwing"), closing(n + 3), opening(n + 4, "erring"),
                     closing(n + 4), opening(n + 6, "after"), closing(n + 6)}));
}

TEST(LogSectionTest, ConcurrentWritersLoseNoLineAndSectionsGetDistinctConsecutiveNumbers) {
    ScopedLogCapture capture;
    constexpr int kThreads = 8, kPerThread = 300;
    std::mutex mutex;
    std::vector<uint64_t> numbers;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < kPerThread; ++i) {
                LogSection section("concurrent");
                logInfo(std::to_string(t) + ":" + std::to_string(i));
                std::lock_guard lock(mutex);
                numbers.push_back(section.number());
            }
        });
    }
    for (auto& t : threads) t.join();
    EXPECT_EQ(capture->countStartingWith("[INFO] "), size_t(kThreads * kPerThread));
    EXPECT_TRUE(capture->contains("[INFO] 7:299"));
    std::sort(numbers.begin(), numbers.end());
    ASSERT_EQ(numbers.size(), size_t(kThreads * kPerThread));
    // Every section opened and closed exactly once under its own number.
    Lines expected, seen = sectionLines(capture);
    for (size_t i = 0; i < numbers.size(); ++i) {
        ASSERT_EQ(numbers[i], numbers[0] + i);
        expected.push_back(opening(numbers[i], "concurrent"));
        expected.push_back(closing(numbers[i]));
    }
    std::sort(expected.begin(), expected.end());
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ(seen, expected);
}

}  // namespace
}  // namespace tamber
