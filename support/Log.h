#pragma once

#include <atomic>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>

#include "support/LogSink.h"

namespace tamber {

template <class T>
class ProcessWide;

// The program's one log handle (subsystem "com.velk.Porter", category "tamber"), created on
// first use. Lines go to the journal when there is one, else to standard error; tests swap in
// a capturing sink. Debug lines are written only while debug logging is enabled.
class Log {
public:
    static constexpr const char* kSubsystem = "com.velk.Porter";
    static constexpr const char* kCategory = "tamber";

    static Log& shared();

    bool debugEnabled() const { return debugEnabled_.load(std::memory_order_relaxed); }
    void setDebugEnabled(bool enabled) { debugEnabled_.store(enabled, std::memory_order_relaxed); }

    // Replaces the sink; returns the previous one.
    std::shared_ptr<LogSink> setSink(std::shared_ptr<LogSink> sink);
    std::shared_ptr<LogSink> sink() const;

    // Writes a finished line as it stands (no level prefix added).
    void write(LogLevel level, std::string_view line);

private:
    friend class ProcessWide<Log>;
    Log();
    std::atomic<bool> debugEnabled_{false};
    std::shared_ptr<LogSink> sink_;  // guarded by std::atomic_load/store
};

// The three line formats "[DEBUG] %@", "[INFO] %@" and "[ERROR] %@": the message is the one
// argument, already built by concatenation.
void logDebug(std::string_view message);
void logInfo(std::string_view message);
void logError(std::string_view message);
// Picks the format for `level`.
void logAt(LogLevel level, std::string_view message);

// Debug lines are written for every item and event; build their text only when it is written.
template <class F>
requires std::is_invocable_v<F>
void logDebug(F&& makeMessage) {
    if (Log::shared().debugEnabled())
        logDebug(std::string_view(std::forward<F>(makeMessage)()));
}

// Formatted lines with the platform's placeholders, used by the identifier module:
// "%@" (a string), "%lu" (unsigned), "%lld" (signed), "%d" (int), "%{errno}d" (an errno value,
// written as "[N: strerror]") and "%%".
struct ErrnoArg {
    int value;
};
using FormatArg = std::variant<std::string, uint64_t, int64_t, ErrnoArg>;

std::string formatPlatform(std::string_view format, std::initializer_list<FormatArg> args);
void logFormat(LogLevel level, std::string_view format, std::initializer_list<FormatArg> args);

// A programming error that stops the process: one error line, then abort.
[[noreturn]] void fatalError(std::string_view message);

}  // namespace tamber
