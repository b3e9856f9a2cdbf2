#include "support/Log.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <thread>

#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

using testing::ScopedLogCapture;

TEST(LogTest, ThreeFormatsAndTheirLevels) {
    ScopedLogCapture log;
    logDebug("found fid=2");
    logInfo("notify changes");
    logError("can't open");
    auto lines = log->lines();
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_EQ(lines[0].text, "[DEBUG] found fid=2");
    EXPECT_EQ(lines[0].level, LogLevel::Debug);
    EXPECT_EQ(lines[1].text, "[INFO] notify changes");
    EXPECT_EQ(lines[1].level, LogLevel::Info);
    EXPECT_EQ(lines[2].text, "[ERROR] can't open");
    EXPECT_EQ(lines[2].level, LogLevel::Error);
}

TEST(LogTest, DebugLinesAreNotEvenBuiltWhenDebugIsOff) {
    ScopedLogCapture log;
    Log::shared().setDebugEnabled(false);
    int built = 0;
    logDebug([&] {
        ++built;
        return std::string("expensive");
    });
    logDebug("plain");
    logFormat(LogLevel::Debug, "%@", {std::string("x")});
    logError("still written");
    EXPECT_EQ(built, 0);
    EXPECT_EQ(log->texts(), std::vector<std::string>{"[ERROR] still written"});

    Log::shared().setDebugEnabled(true);
    logDebug([&] {
        ++built;
        return std::string("expensive");
    });
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

TEST(LogTest, FormattedLinesCarryNoLevelPrefix) {
    ScopedLogCapture log;
    logFormat(LogLevel::Info, "can't resolve path matching file ID \"%lld\"; %{errno}d",
              {int64_t{12}, ErrnoArg{ESTALE}});
    ASSERT_EQ(log->lines().size(), 1u);
    EXPECT_EQ(log->lines()[0].level, LogLevel::Info);
    EXPECT_EQ(log->lines()[0].text.rfind("can't resolve path matching file ID \"12\"; [", 0), 0u);
}

TEST(LogTest, ConcurrentWritersLoseNoLine) {
    ScopedLogCapture log;
    constexpr int kThreads = 8, kLines = 500;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t)
        threads.emplace_back([t] {
            for (int i = 0; i < kLines; ++i) logInfo(std::to_string(t) + ":" + std::to_string(i));
        });
    for (auto& th : threads) th.join();
    EXPECT_EQ(log->lines().size(), size_t(kThreads * kLines));
    EXPECT_TRUE(log->contains("[INFO] 7:499"));
}

TEST(LogDeathTest, FatalErrorLogsAndStops) {
    EXPECT_DEATH(fatalError("log-section counter overflow"), "log-section counter overflow");
}

}  // namespace
}  // namespace tamber
