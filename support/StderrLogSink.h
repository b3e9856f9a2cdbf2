#pragma once

#include <mutex>

#include "support/LogSink.h"

namespace tamber {

// Writes "tamber[LEVEL] line" to standard error, one whole line per write.
class StderrLogSink : public LogSink {
public:
    void write(LogLevel level, std::string_view line) override;

private:
    std::mutex mutex_;
};

}  // namespace tamber
