#pragma once

#include "platform/FileSystem.h"

namespace tamber {

// One descriptor, closed when the scope ends (keeping errno for the caller).
class ScopedFd {
public:
    explicit ScopedFd(int fd = -1) : fd_(fd) {}
    ScopedFd(const ScopedFd&) = delete;
    ScopedFd& operator=(const ScopedFd&) = delete;
    ~ScopedFd() {
        if (fd_ >= 0) {
            int saved = errno;
            FileSystem::current().close(fd_);
            errno = saved;
        }
    }
    int get() const { return fd_; }
    bool ok() const { return fd_ >= 0; }

private:
    int fd_;
};

}  // namespace tamber
