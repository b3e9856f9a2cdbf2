#pragma once

#include <memory>

#include "platform/FileSystem.h"

namespace tamber::testing {

// Installs `fs` as the process-wide file system for the lifetime of the object and restores
// the previous one afterwards.
class ScopedFileSystem {
public:
    explicit ScopedFileSystem(std::shared_ptr<FileSystem> fs);
    ~ScopedFileSystem();
    ScopedFileSystem(const ScopedFileSystem&) = delete;
    ScopedFileSystem& operator=(const ScopedFileSystem&) = delete;

private:
    std::shared_ptr<FileSystem> previous_;
};

}  // namespace tamber::testing
