#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tamber {

// Ages as people type them and as the purge request carries them: "30d", "12h", "90m", "45s".
class Duration {
public:
    // The seconds of a whole number followed by one unit; nothing when malformed or too large.
    static std::optional<double> parse(const std::string& text);
    // The same seconds in the largest unit that says them exactly ("36h", not "1.5d").
    static std::string text(uint64_t seconds);
};

}  // namespace tamber
