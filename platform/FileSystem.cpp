#include "platform/FileSystem.h"

#include <atomic>
#include <cerrno>

#include "platform/LinuxFileSystem.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

// A runtime installs its file system here for its lifetime; threads that outlive main still
// reach one, whatever the order of static destruction.
std::shared_ptr<FileSystem>& slot() {
    static ProcessWide<std::shared_ptr<FileSystem>> fs(std::make_shared<LinuxFileSystem>());
    return *fs;
}

}  // namespace

ssize_t FileSystem::pread(int, void*, size_t, off_t) {
    errno = ENOSYS;
    return -1;
}

std::shared_ptr<FileSystem> FileSystem::currentShared() {
    return std::atomic_load(&slot());
}

FileSystem& FileSystem::current() {
    // The instance stays alive while tests swap it: they keep the previous one and restore it.
    return *std::atomic_load(&slot());
}

std::shared_ptr<FileSystem> FileSystem::setCurrent(std::shared_ptr<FileSystem> fs) {
    return std::atomic_exchange(&slot(), std::move(fs));
}

}  // namespace tamber
