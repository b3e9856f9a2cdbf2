#pragma once

#include <cstdint>

#include "platform/FileSystem.h"
#include "support/Result.h"

namespace tamber {

// What tells that a directory has not changed since a moment before: its identity (device and
// inode) and its modification and change times. Something read from a directory may be kept
// under its stamp, and served while the stamp is the same, only when the stamp is old enough
// that a change in the same timestamp tick can't hide behind it.
struct DirectoryStamp {
    uint32_t deviceMajor = 0;
    uint32_t deviceMinor = 0;
    uint64_t inode = 0;
    int64_t mtimeSeconds = 0;
    uint32_t mtimeNanoseconds = 0;
    int64_t ctimeSeconds = 0;
    uint32_t ctimeNanoseconds = 0;
    friend bool operator==(const DirectoryStamp&, const DirectoryStamp&) = default;

    // How long after a directory's last change what was read from it may be kept, for file
    // systems with nanosecond stamps and with whole-second ones.
    static constexpr int64_t kFineMarginNanoseconds = 50'000'000;
    static constexpr int64_t kCoarseMarginNanoseconds = 2'000'000'000;

    // The stamp of the open directory `fd` (at `path`, for the error): a missing directory is
    // HostPlatformErrorDomain 260, any other failure its POSIX error.
    static Result<DirectoryStamp> of(FileSystem& fs, int fd, const std::string& path);
    // The same directory, whatever its times.
    bool sameDirectory(const DirectoryStamp& other) const {
        return inode == other.inode && deviceMajor == other.deviceMajor &&
               deviceMinor == other.deviceMinor;
    }
    // Whether the directory last changed well before now.
    bool oldEnoughToKeep() const;
};

// The error of a failed read of the directory at `path`.
Error directoryReadError(int error, const std::string& path);

}  // namespace tamber
