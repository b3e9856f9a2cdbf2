#include "runtime/Duration.h"

#include <gtest/gtest.h>

namespace tamber {
namespace {

TEST(DurationTest, ReadsWholeAmountsWithOneUnitAndRefusesTheRest) {
    EXPECT_EQ(Duration::parse("30d"), 30 * 86400.0);
    EXPECT_EQ(Duration::parse("12h"), 12 * 3600.0);
    EXPECT_EQ(Duration::parse("90m"), 90 * 60.0);
    EXPECT_EQ(Duration::parse("0s"), 0.0);
    for (const char* bad : {"", "d", "30", "-1d", "1.5h", "30w", "3 d", "99999999999999999999d"})
        EXPECT_FALSE(Duration::parse(bad).has_value()) << bad;
}

TEST(DurationTest, WritesTheLargestExactUnitAndReadsItBack) {
    EXPECT_EQ(Duration::text(30 * 86400), "30d");
    EXPECT_EQ(Duration::text(36 * 3600), "36h");
    EXPECT_EQ(Duration::text(90 * 60), "90m");
    EXPECT_EQ(Duration::text(86401), "86401s");
    EXPECT_EQ(Duration::text(0), "0s");
    for (uint64_t seconds : {0ull, 59ull, 60ull, 3601ull, 7200ull, 86400ull * 400})
        EXPECT_EQ(Duration::parse(Duration::text(seconds)), static_cast<double>(seconds));
}

}  // namespace
}  // namespace tamber
