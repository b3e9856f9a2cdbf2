#include "support/CaptureLogSink.h"
#include "support/MutexLock.h"

namespace tamber {

void CaptureLogSink::write(LogLevel level, std::string_view line) {
    MutexLock lock(mutex_);
    lines_.push_back({level, std::string(line)});
}

std::vector<CaptureLogSink::Line> CaptureLogSink::lines() const {
    MutexLock lock(mutex_);
    return lines_;
}

std::vector<std::string> CaptureLogSink::texts() const {
    MutexLock lock(mutex_);
    std::vector<std::string> out;
    out.reserve(lines_.size());
    for (const auto& l : lines_) out.push_back(l.text);
    return out;
}

size_t CaptureLogSink::count(std::string_view text, LogLevel level) const {
    MutexLock lock(mutex_);
    size_t n = 0;
    for (const auto& l : lines_) n += (l.level == level && l.text == text) ? 1 : 0;
    return n;
}

size_t CaptureLogSink::countStartingWith(std::string_view prefix) const {
    MutexLock lock(mutex_);
    size_t n = 0;
    for (const auto& l : lines_) n += l.text.rfind(prefix, 0) == 0 ? 1 : 0;
    return n;
}

bool CaptureLogSink::contains(std::string_view text) const {
    MutexLock lock(mutex_);
    for (const auto& l : lines_)
        if (l.text == text)
            return true;
    return false;
}

void CaptureLogSink::clear() {
    MutexLock lock(mutex_);
    lines_.clear();
}

}  // namespace tamber
