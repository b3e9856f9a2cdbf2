#pragma once

#include "support/LogSink.h"
#include "support/Mutex.h"

namespace tamber {

// Writes "tamber: line" to standard error, one whole line per write, leaving out lines below
// `minimum` (a command line shows only errors unless asked for more).
class StderrLogSink : public LogSink {
public:
    explicit StderrLogSink(LogLevel minimum = LogLevel::Debug) : minimum_(minimum) {}
    void write(LogLevel level, std::string_view line) override;
    LogLevel minimum() const { return minimum_; }

private:
    const LogLevel minimum_;
    // Keeps the lines of different threads whole; it guards no member.
    Mutex mutex_;
};

}  // namespace tamber
