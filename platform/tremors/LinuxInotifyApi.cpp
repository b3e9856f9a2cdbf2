#include "platform/tremors/LinuxInotifyApi.h"

#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <unistd.h>

namespace tamber {

int LinuxInotifyApi::init(int flags) {
    return ::inotify_init1(flags);
}

int LinuxInotifyApi::addWatch(int fd, const std::string& path, uint32_t mask) {
    return ::inotify_add_watch(fd, path.c_str(), mask);
}

int LinuxInotifyApi::removeWatch(int fd, int wd) {
    return ::inotify_rm_watch(fd, wd);
}

ssize_t LinuxInotifyApi::read(int fd, void* buffer, size_t size) {
    return ::read(fd, buffer, size);
}

int LinuxInotifyApi::queuedBytes(int fd) {
    int bytes = 0;
    if (::ioctl(fd, FIONREAD, &bytes) < 0)
        return -1;
    return bytes;
}

int LinuxInotifyApi::eventfd(unsigned int initial, int flags) {
    return ::eventfd(initial, flags);
}

int LinuxInotifyApi::signal(int eventFd) {
    return ::eventfd_write(eventFd, 1);
}

int LinuxInotifyApi::poll(struct pollfd* fds, nfds_t count, int timeoutMs) {
    return ::poll(fds, count, timeoutMs);
}

int LinuxInotifyApi::close(int fd) {
    return ::close(fd);
}

}  // namespace tamber
