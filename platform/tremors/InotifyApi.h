#pragma once

#include <poll.h>
#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>

namespace tamber {

// The system calls the inotify backend makes, behind an interface so that tests can make them
// fail (a watch limit reached, an instance limit reached). Methods behave like the calls they
// are named after: -1 with errno set on failure.
class InotifyApi {
public:
    virtual ~InotifyApi() = default;

    // The process-wide real implementation.
    static std::shared_ptr<InotifyApi> system();

    // inotify_init1(2).
    virtual int init(int flags) = 0;
    // inotify_add_watch(2) and inotify_rm_watch(2).
    virtual int addWatch(int fd, const std::string& path, uint32_t mask) = 0;
    virtual int removeWatch(int fd, int wd) = 0;
    // read(2) of queued events.
    virtual ssize_t read(int fd, void* buffer, size_t size) = 0;
    // How many bytes of events are queued (ioctl FIONREAD); -1 on failure.
    virtual int queuedBytes(int fd) = 0;
    // eventfd(2), and adding one to its counter (eventfd_write).
    virtual int eventfd(unsigned int initial, int flags) = 0;
    virtual int signal(int eventFd) = 0;
    virtual int poll(struct pollfd* fds, nfds_t count, int timeoutMs) = 0;
    virtual int close(int fd) = 0;
};

}  // namespace tamber
