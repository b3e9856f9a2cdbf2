#pragma once

#include <string>
#include <vector>

#include "support/LogSink.h"
#include "support/Mutex.h"

namespace tamber {

// Keeps every line in memory; tests assert on whole lines.
class CaptureLogSink : public LogSink {
public:
    struct Line {
        LogLevel level;
        std::string text;
    };

    void write(LogLevel level, std::string_view line) override;

    std::vector<Line> lines() const;
    std::vector<std::string> texts() const;
    // Lines equal to `text`, at `level`.
    size_t count(std::string_view text, LogLevel level) const;
    // Lines that start with `prefix`, at any level.
    size_t countStartingWith(std::string_view prefix) const;
    bool contains(std::string_view text) const;
    void clear();

private:
    mutable Mutex mutex_;
    std::vector<Line> lines_ GUARDED_BY(mutex_);
};

}  // namespace tamber
