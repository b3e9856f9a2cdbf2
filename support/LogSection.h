#pragma once

#include <cstdint>
#include <string_view>
#include <utility>

namespace tamber {

// A numbered stretch of the debug log around one operation the host asked for: "┏<n> <title>"
// when it opens, "┗<n>" when it closes, however the operation ends. Numbers count up from 0
// across the process and are taken even while debug lines are not written, so they stay
// comparable between runs with and without debug logging.
class LogSection {
public:
    explicit LogSection(std::string_view title);
    ~LogSection();
    LogSection(const LogSection&) = delete;
    LogSection& operator=(const LogSection&) = delete;

    uint64_t number() const { return number_; }

    // Takes the next section number.
    static uint64_t takeNumber();

private:
    uint64_t number_;
};

// Runs `work` inside a section and returns its result; an exception still closes the section
// before it propagates.
template <class F>
auto withLogSection(std::string_view title, F&& work) -> decltype(std::forward<F>(work)()) {
    LogSection section(title);
    return std::forward<F>(work)();
}

}  // namespace tamber
