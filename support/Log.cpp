#include "support/Log.h"

#include <cstdlib>
#include <cstring>

#include "support/JournalLogSink.h"
#include "support/ProcessWide.h"
#include "support/StderrLogSink.h"

namespace tamber {

const char* logLevelName(LogLevel level) {
    switch (level) {
        case LogLevel::Debug:
            return "debug";
        case LogLevel::Info:
            return "info";
        case LogLevel::Error:
            return "error";
    }
    return "?";
}

Log::Log() {
    if (JournalLogSink::available()) {
        sink_ = std::make_shared<JournalLogSink>(kSubsystem, kCategory);
    } else {
        sink_ = std::make_shared<StderrLogSink>();
    }
}

Log& Log::shared() {
    static ProcessWide<Log> log;  // threads may log while the process exits
    return *log;
}

std::shared_ptr<LogSink> Log::setSink(std::shared_ptr<LogSink> sink) {
    return std::atomic_exchange(&sink_, std::move(sink));
}

std::shared_ptr<LogSink> Log::sink() const {
    return std::atomic_load(&sink_);
}

void Log::write(LogLevel level, std::string_view line) {
    if (level == LogLevel::Debug && !debugEnabled())
        return;
    if (auto s = sink())
        s->write(level, line);
}

namespace {

void writePrefixed(LogLevel level, const char* prefix, std::string_view message) {
    Log& log = Log::shared();
    if (level == LogLevel::Debug && !log.debugEnabled())
        return;
    std::string line;
    line.reserve(std::strlen(prefix) + message.size());
    line.append(prefix).append(message);
    log.write(level, line);
}

}  // namespace

void logDebug(std::string_view message) {
    writePrefixed(LogLevel::Debug, "[DEBUG] ", message);
}
void logInfo(std::string_view message) {
    writePrefixed(LogLevel::Info, "[INFO] ", message);
}
void logError(std::string_view message) {
    writePrefixed(LogLevel::Error, "[ERROR] ", message);
}

void logAt(LogLevel level, std::string_view message) {
    switch (level) {
        case LogLevel::Debug:
            return logDebug(message);
        case LogLevel::Info:
            return logInfo(message);
        case LogLevel::Error:
            return logError(message);
    }
}

namespace {

void appendArg(std::string& out, const FormatArg& arg) {
    if (auto s = std::get_if<std::string>(&arg)) {
        out += *s;
    } else if (auto u = std::get_if<uint64_t>(&arg)) {
        out += std::to_string(*u);
    } else if (auto i = std::get_if<int64_t>(&arg)) {
        out += std::to_string(*i);
    } else if (auto e = std::get_if<ErrnoArg>(&arg)) {
        out += "[" + std::to_string(e->value) + ": " + std::strerror(e->value) + "]";
    }
}

}  // namespace

std::string formatPlatform(std::string_view format, std::initializer_list<FormatArg> args) {
    static constexpr std::string_view kPlaceholders[] = {"%{errno}d", "%lld", "%lu", "%@", "%d"};
    std::string out;
    out.reserve(format.size() + 32);
    auto next = args.begin();
    for (size_t i = 0; i < format.size();) {
        if (format[i] != '%') {
            out.push_back(format[i++]);
            continue;
        }
        if (format.substr(i, 2) == "%%") {
            out.push_back('%');
            i += 2;
            continue;
        }
        bool matched = false;
        for (auto p : kPlaceholders) {
            if (format.substr(i, p.size()) == p) {
                if (next != args.end())
                    appendArg(out, *next++);
                i += p.size();
                matched = true;
                break;
            }
        }
        if (!matched)
            out.push_back(format[i++]);
    }
    return out;
}

void logFormat(LogLevel level, std::string_view format, std::initializer_list<FormatArg> args) {
    Log& log = Log::shared();
    if (level == LogLevel::Debug && !log.debugEnabled())
        return;
    log.write(level, formatPlatform(format, args));
}

void fatalError(std::string_view message) {
    std::string line = std::string("[ERROR] fatal: ").append(message);
    Log::shared().write(LogLevel::Error, line);
    // The journal may be where the line went; the person at the terminal should see it too.
    if (!std::dynamic_pointer_cast<StderrLogSink>(Log::shared().sink())) {
        StderrLogSink().write(LogLevel::Error, line);
    }
    std::abort();
}

}  // namespace tamber
