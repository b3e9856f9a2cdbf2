#include "platform/objects/Date.h"

#include <chrono>
#include <cmath>
#include <ctime>

namespace tamber {

std::shared_ptr<const Date> Date::make(double secondsSince1970) {
    return std::make_shared<const Date>(secondsSince1970);
}

std::shared_ptr<const Date> Date::now() {
    auto since = std::chrono::system_clock::now().time_since_epoch();
    return make(std::chrono::duration<double>(since).count());
}

std::string Date::iso8601() const {
    if (!std::isfinite(seconds_))
        return "invalid date";
    double whole = std::floor(seconds_);
    auto millis = static_cast<int>(std::lround((seconds_ - whole) * 1000.0));
    if (millis == 1000) {
        whole += 1;
        millis = 0;
    }
    // Out of time_t's range there is no calendar date to show.
    if (whole < -6.2e10 || whole > 2.5e11)
        return "invalid date";
    std::time_t t = static_cast<std::time_t>(whole);
    std::tm tm{};
    if (!gmtime_r(&t, &tm))
        return "invalid date";
    char buf[64];
    std::snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02d.%03dZ", tm.tm_year + 1900,
                  tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, millis);
    return buf;
}

bool Date::isEqual(const Object& other) const {
    auto d = dynamic_cast<const Date*>(&other);
    return d && d->seconds_ == seconds_;
}

}  // namespace tamber
