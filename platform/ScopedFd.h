#pragma once

#include <cerrno>

#include "platform/FileSystem.h"

namespace tamber {

// One descriptor, closed through FileSystem::current() when the scope ends, so that a test's
// fault-injecting file system sees the close too. Closing keeps errno for the caller: the
// error a function returns after a failed call is that call's, not the close's.
class ScopedFd {
public:
    explicit ScopedFd(int fd = -1) : fd_(fd) {}
    ScopedFd(ScopedFd&& other) noexcept : fd_(other.release()) {}
    ScopedFd& operator=(ScopedFd&& other) noexcept {
        if (this != &other)
            reset(other.release());
        return *this;
    }
    ScopedFd(const ScopedFd&) = delete;
    ScopedFd& operator=(const ScopedFd&) = delete;
    ~ScopedFd() { reset(); }

    int get() const { return fd_; }
    bool ok() const { return fd_ >= 0; }

    // Hands the descriptor over to the caller, who closes it.
    int release() {
        int fd = fd_;
        fd_ = -1;
        return fd;
    }
    // Closes the descriptor held (errno kept) and holds `fd` instead.
    void reset(int fd = -1) {
        if (fd_ >= 0) {
            int saved = errno;
            FileSystem::current().close(fd_);
            errno = saved;
        }
        fd_ = fd;
    }
    // Closes now and returns what close returned (errno set by it), for a writer whose last
    // error may show only at close; 0 when nothing was held.
    int close() {
        int fd = release();
        return fd < 0 ? 0 : FileSystem::current().close(fd);
    }

private:
    int fd_;
};

}  // namespace tamber
