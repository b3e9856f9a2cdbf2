#include "support/StderrLogSink.h"
#include "support/MutexLock.h"

#include <unistd.h>

#include <string>

namespace tamber {

void StderrLogSink::write(LogLevel level, std::string_view line) {
    if (level < minimum_)
        return;
    std::string text;
    text.reserve(line.size() + 8);
    text.append("tamber: ").append(line).push_back('\n');
    MutexLock lock(mutex_);
    // One write call per line so that lines from several processes do not interleave.
    size_t done = 0;
    while (done < text.size()) {
        ssize_t n = ::write(STDERR_FILENO, text.data() + done, text.size() - done);
        if (n <= 0)
            break;
        done += static_cast<size_t>(n);
    }
}

}  // namespace tamber
