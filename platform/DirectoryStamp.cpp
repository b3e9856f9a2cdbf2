#include "platform/DirectoryStamp.h"

#include <algorithm>
#include <cerrno>
#include <chrono>

namespace tamber {

namespace {

int64_t nanoseconds(int64_t seconds, uint32_t nanoseconds) {
    return seconds * 1'000'000'000 + nanoseconds;
}

}  // namespace

Error directoryReadError(int error, const std::string& path) {
    if (error == ENOENT)
        return Error::fileNoSuchFile(path);
    return Error::posix(error);
}

Result<DirectoryStamp> DirectoryStamp::of(FileSystem& fs, int fd, const std::string& path) {
    struct statx st {};
    if (fs.statx(fd, "", AT_EMPTY_PATH, STATX_INO | STATX_MTIME | STATX_CTIME, &st) != 0)
        return directoryReadError(errno, path);
    DirectoryStamp stamp;
    stamp.deviceMajor = st.stx_dev_major;
    stamp.deviceMinor = st.stx_dev_minor;
    stamp.inode = st.stx_ino;
    stamp.mtimeSeconds = st.stx_mtime.tv_sec;
    stamp.mtimeNanoseconds = st.stx_mtime.tv_nsec;
    stamp.ctimeSeconds = st.stx_ctime.tv_sec;
    stamp.ctimeNanoseconds = st.stx_ctime.tv_nsec;
    return stamp;
}

bool DirectoryStamp::oldEnoughToKeep() const {
    // File times come from a clock that ticks every few milliseconds (every second or two on
    // some file systems): a change in the same tick as the read would leave the stamp as it
    // was. Keep only what was read from directories that last changed well before the read.
    int64_t changed = std::max(nanoseconds(mtimeSeconds, mtimeNanoseconds),
                               nanoseconds(ctimeSeconds, ctimeNanoseconds));
    bool coarse = mtimeNanoseconds == 0 && ctimeNanoseconds == 0;
    int64_t margin = coarse ? kCoarseMarginNanoseconds : kFineMarginNanoseconds;
    int64_t now = std::chrono::duration_cast<std::chrono::nanoseconds>(
                      std::chrono::system_clock::now().time_since_epoch())
                      .count();
    return now - changed > margin;
}

}  // namespace tamber
