#pragma once

#include "support/LogSink.h"

namespace tamber {

// Sends lines to the systemd journal with the subsystem and category as fields.
class JournalLogSink : public LogSink {
public:
    JournalLogSink(const char* subsystem, const char* category);
    void write(LogLevel level, std::string_view line) override;

    // Whether a journal is there to receive lines.
    static bool available();

private:
    const char* subsystem_;
    const char* category_;
};

}  // namespace tamber
