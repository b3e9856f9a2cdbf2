#include "platform/device/DeviceAnswer.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>

#include "platform/objects/Number.h"
#include "platform/objects/String.h"

namespace tamber {
namespace {

// Sets (or unsets, with nullopt) an environment variable for a scope.
struct ScopedDeviceEnv {
    ScopedDeviceEnv(const char* name, std::optional<std::string> value) : name(name) {
        if (const char* old = std::getenv(name))
            previous = old;
        set(value);
    }
    ~ScopedDeviceEnv() { set(previous); }
    void set(const std::optional<std::string>& v) {
        v ? ::setenv(name, v->c_str(), 1) : ::unsetenv(name);
    }
    const char* name;
    std::optional<std::string> previous;
};

TEST(DeviceClassTest, TabletsAndHandsetsComeFromTheChassis) {
    const struct {
        std::string machineInfo, dmi;
        int64_t expected;
    } cases[] = {
        {"", "", kDeviceClassComputer},
        {"", "30\n", kDeviceClassTablet},
        {"", "9\n", kDeviceClassComputer},   // laptop
        {"", "31\n", kDeviceClassComputer},  // convertible: a laptop most of the time
        {"", "garbage", kDeviceClassComputer},
        {"", "300", kDeviceClassComputer},
        {"PRETTY_HOSTNAME=x\nCHASSIS=tablet\n", "3", kDeviceClassTablet},
        {"CHASSIS=\"handset\"", "", kDeviceClassHandset},
        {"  CHASSIS='tablet'  \r\n", "", kDeviceClassTablet},
        // What the administrator set wins over the firmware; the last assignment counts.
        {"CHASSIS=laptop\n", "30", kDeviceClassComputer},
        {"CHASSIS=tablet\nCHASSIS=desktop\n", "30", kDeviceClassComputer},
        {"#CHASSIS=tablet\n", "", kDeviceClassComputer},
        {"CHASSIS=\"tablet\n", "", kDeviceClassComputer},  // unbalanced quote
    };
    for (const auto& c : cases) {
        EXPECT_EQ(DeviceClassForChassis(c.machineInfo, c.dmi), c.expected)
            << "[" << c.machineInfo << "] [" << c.dmi << "]";
    }
}

TEST(ScreenScaleTest, ReadsTheSessionScaleAndIgnoresNonsense) {
    ScopedDeviceEnv gdk("GDK_SCALE", std::nullopt);
    ScopedDeviceEnv qt("QT_SCALE_FACTOR", std::nullopt);
    EXPECT_EQ(ScreenScaleFromEnvironment(), 1.0f);
    qt.set("1.5");
    EXPECT_EQ(ScreenScaleFromEnvironment(), 1.5f);
    gdk.set("2");
    EXPECT_EQ(ScreenScaleFromEnvironment(), 2.0f) << "GTK's setting comes first";
    for (const char* bad : {"", "0", "-2", "two", "2x", "nan", "inf", "1e9"}) {
        gdk.set(bad);
        EXPECT_EQ(ScreenScaleFromEnvironment(), 1.5f) << bad;
    }
}

TEST(CopyDeviceAnswerTest, AnswersNumbersAndHonoursOverrides) {
    ScopedDeviceEnv gdk("GDK_SCALE", "3");
    auto scale = objectCast<Number>(CopyDeviceAnswer(DeviceAnswerKeys::kMainScreenScale));
    ASSERT_TRUE(scale);
    EXPECT_EQ(scale->doubleValue(), 3.0);
    auto deviceClass = objectCast<Number>(CopyDeviceAnswer(DeviceAnswerKeys::kDeviceClassNumber));
    ASSERT_TRUE(deviceClass);
    EXPECT_GE(deviceClass->int64Value(), 0);
    EXPECT_FALSE(CopyDeviceAnswer("no-such-question"));

    SetDeviceAnswerOverride(std::string(DeviceAnswerKeys::kDeviceClassNumber),
                            Number::fromInt64(kDeviceClassTablet));
    SetDeviceAnswerOverride(std::string(DeviceAnswerKeys::kMainScreenScale), nullptr);
    SetDeviceAnswerOverride("colour", String::make("blue"));
    EXPECT_EQ(
        objectCast<Number>(CopyDeviceAnswer(DeviceAnswerKeys::kDeviceClassNumber))->int64Value(),
        kDeviceClassTablet);
    EXPECT_FALSE(CopyDeviceAnswer(DeviceAnswerKeys::kMainScreenScale)) << "overridden to none";
    EXPECT_TRUE(CopyDeviceAnswer("colour"));
    ClearDeviceAnswerOverrides();
    EXPECT_EQ(
        objectCast<Number>(CopyDeviceAnswer(DeviceAnswerKeys::kMainScreenScale))->doubleValue(),
        3.0);
    EXPECT_FALSE(CopyDeviceAnswer("colour"));
}

}  // namespace
}  // namespace tamber
