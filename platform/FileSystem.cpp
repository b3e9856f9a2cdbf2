#include "platform/FileSystem.h"

#include <atomic>

#include "platform/LinuxFileSystem.h"

namespace tamber {

namespace {

// Never destroyed: services that outlive main (the journal closes its store from a static's
// destructor at exit) still reach a file system, whatever the order of static destruction.
std::shared_ptr<FileSystem>& slot() {
    static auto* fs = new std::shared_ptr<FileSystem>(std::make_shared<LinuxFileSystem>());
    return *fs;
}

}  // namespace

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
