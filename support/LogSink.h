#pragma once

#include <string_view>

namespace tamber {

enum class LogLevel { Debug, Info, Error };

const char* logLevelName(LogLevel level);

// Where finished log lines go. Implementations must be safe to call from any thread.
class LogSink {
public:
    virtual ~LogSink() = default;
    virtual void write(LogLevel level, std::string_view line) = 0;
};

}  // namespace tamber
