#pragma once

#include "platform/tremors/InotifyApi.h"

namespace tamber {

// The real system calls.
class LinuxInotifyApi : public InotifyApi {
public:
    int init(int flags) override;
    int addWatch(int fd, const std::string& path, uint32_t mask) override;
    int removeWatch(int fd, int wd) override;
    ssize_t read(int fd, void* buffer, size_t size) override;
    int queuedBytes(int fd) override;
    int eventfd(unsigned int initial, int flags) override;
    int signal(int eventFd) override;
    int poll(struct pollfd* fds, nfds_t count, int timeoutMs) override;
    int close(int fd) override;
};

}  // namespace tamber
