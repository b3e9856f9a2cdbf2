#include "tests/common/ScopedFileSystem.h"

namespace tamber::testing {

ScopedFileSystem::ScopedFileSystem(std::shared_ptr<FileSystem> fs)
    : previous_(FileSystem::setCurrent(std::move(fs))) {}

ScopedFileSystem::~ScopedFileSystem() {
    FileSystem::setCurrent(std::move(previous_));
}

}  // namespace tamber::testing
