#include "runtime/Duration.h"

#include <charconv>

namespace tamber {

std::optional<double> Duration::parse(const std::string& text) {
    if (text.size() < 2)
        return std::nullopt;
    double unit = 0;
    switch (text.back()) {
        case 's':
            unit = 1;
            break;
        case 'm':
            unit = 60;
            break;
        case 'h':
            unit = 3600;
            break;
        case 'd':
            unit = 86400;
            break;
        default:
            return std::nullopt;
    }
    uint64_t amount = 0;
    const char* end = text.data() + text.size() - 1;
    auto [stop, ec] = std::from_chars(text.data(), end, amount);
    if (ec != std::errc() || stop != end)
        return std::nullopt;
    return static_cast<double>(amount) * unit;
}

std::string Duration::text(uint64_t seconds) {
    if (seconds != 0 && seconds % 86400 == 0)
        return std::to_string(seconds / 86400) + "d";
    if (seconds != 0 && seconds % 3600 == 0)
        return std::to_string(seconds / 3600) + "h";
    if (seconds != 0 && seconds % 60 == 0)
        return std::to_string(seconds / 60) + "m";
    return std::to_string(seconds) + "s";
}

}  // namespace tamber
