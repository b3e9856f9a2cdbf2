#include "platform/device/DeviceAnswer.h"

#include <charconv>
#include <cmath>
#include <cstdlib>
#include <map>

#include "platform/FileContents.h"
#include "platform/objects/Number.h"
#include "support/MutexLock.h"

namespace tamber {

namespace {

constexpr const char* kMachineInfoPath = "/etc/machine-info";
constexpr const char* kChassisTypePath = "/sys/class/dmi/id/chassis_type";
constexpr int kSmbiosTablet = 30;
// Beyond any real display; a larger value is a typo, not a scale.
constexpr float kLargestScale = 16.0f;

struct Overrides {
    Mutex mutex;
    std::map<std::string, ObjectRef, std::less<>> values GUARDED_BY(mutex);
};

Overrides& overrides() {
    static Overrides instance;
    return instance;
}

std::string_view trim(std::string_view text) {
    size_t begin = text.find_first_not_of(" \t\r\n");
    if (begin == std::string_view::npos)
        return {};
    size_t end = text.find_last_not_of(" \t\r\n");
    return text.substr(begin, end - begin + 1);
}

// The value of CHASSIS= in an environment-style file, without its quotes.
std::string_view chassisValue(std::string_view machineInfo) {
    std::string_view value;
    while (!machineInfo.empty()) {
        size_t newline = machineInfo.find('\n');
        std::string_view line = trim(machineInfo.substr(0, newline));
        machineInfo = newline == std::string_view::npos ? std::string_view()
                                                        : machineInfo.substr(newline + 1);
        if (line.starts_with("CHASSIS="))
            value = trim(line.substr(8));  // the last assignment wins, as in a shell
    }
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') &&
        value.back() == value.front())
        value = value.substr(1, value.size() - 2);
    return value;
}

std::string readSmallFile(const char* path) {
    auto bytes = FileContents::read(Url::fileURLWithPath(path));
    if (!bytes.ok() || bytes->size() > 64 * 1024)
        return {};
    return std::string(bytes->begin(), bytes->end());
}

std::optional<float> positiveScale(const char* variable) {
    const char* text = std::getenv(variable);
    if (!text)
        return std::nullopt;
    std::string_view value = trim(text);
    float scale = 0;
    auto [end, ec] = std::from_chars(value.data(), value.data() + value.size(), scale);
    if (ec != std::errc() || end != value.data() + value.size() || !std::isfinite(scale) ||
        scale <= 0 || scale > kLargestScale)
        return std::nullopt;
    return scale;
}

}  // namespace

int64_t DeviceClassForChassis(std::string_view machineInfo, std::string_view dmiChassisType) {
    std::string_view chassis = chassisValue(machineInfo);
    if (chassis == "tablet")
        return kDeviceClassTablet;
    if (chassis == "handset")
        return kDeviceClassHandset;
    if (!chassis.empty())
        return kDeviceClassComputer;
    std::string_view type = trim(dmiChassisType);
    int number = 0;
    auto [end, ec] = std::from_chars(type.data(), type.data() + type.size(), number);
    if (ec == std::errc() && end == type.data() + type.size() && number == kSmbiosTablet)
        return kDeviceClassTablet;
    return kDeviceClassComputer;
}

float ScreenScaleFromEnvironment() {
    if (auto scale = positiveScale("GDK_SCALE"))
        return *scale;
    if (auto scale = positiveScale("QT_SCALE_FACTOR"))
        return *scale;
    return 1.0f;
}

ObjectRef CopyDeviceAnswer(std::string_view key) {
    {
        Overrides& o = overrides();
        MutexLock lock(o.mutex);
        if (auto it = o.values.find(key); it != o.values.end())
            return it->second;
    }
    if (key == DeviceAnswerKeys::kDeviceClassNumber)
        return Number::fromInt64(DeviceClassForChassis(readSmallFile(kMachineInfoPath),
                                                       readSmallFile(kChassisTypePath)));
    if (key == DeviceAnswerKeys::kMainScreenScale)
        return Number::fromDouble(ScreenScaleFromEnvironment());
    return nullptr;
}

void SetDeviceAnswerOverride(std::string key, ObjectRef value) {
    Overrides& o = overrides();
    MutexLock lock(o.mutex);
    o.values[std::move(key)] = std::move(value);
}

void ClearDeviceAnswerOverrides() {
    Overrides& o = overrides();
    MutexLock lock(o.mutex);
    o.values.clear();
}

}  // namespace tamber
