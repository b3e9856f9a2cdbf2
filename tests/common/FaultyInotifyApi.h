#pragma once

#include <unistd.h>

#include <cerrno>
#include <map>
#include <mutex>
#include <string>

#include "platform/tremors/LinuxInotifyApi.h"

namespace tamber::testing {

// The real calls, except add_watch for directories whose path contains one of the given
// strings. Watches are added through "/proc/self/fd/N/.", so the descriptor is resolved first.
class FaultyInotifyApi : public LinuxInotifyApi {
public:
    void failAddWatch(std::string pathSubstring, int error) {
        std::lock_guard lock(mutex_);
        failures_[std::move(pathSubstring)] = error;
    }
    int addWatch(int fd, const std::string& path, uint32_t mask) override {
        std::string target = path;
        if (path.starts_with("/proc/self/fd/")) {
            char link[4096];
            ssize_t n = ::readlink(path.substr(0, path.find('/', 14)).c_str(), link, sizeof link);
            if (n >= 0)
                target.assign(link, static_cast<size_t>(n));
        }
        std::lock_guard lock(mutex_);
        for (const auto& [substring, error] : failures_) {
            if (target.find(substring) != std::string::npos) {
                errno = error;
                return -1;
            }
        }
        return LinuxInotifyApi::addWatch(fd, path, mask);
    }

private:
    std::mutex mutex_;
    std::map<std::string, int> failures_;
};

}  // namespace tamber::testing
