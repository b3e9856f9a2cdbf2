#include "host/StagedFile.h"

#include <fcntl.h>

#include <cerrno>
#include <vector>

#include "host/ItemNames.h"
#include "host/PublishedTrees.h"
#include "host/StagingCopies.h"
#include "host/UrlOperations.h"
#include "platform/FileSystem.h"

namespace tamber {

namespace {

Error errnoError() {
    return Error::posix(errno);
}

}  // namespace

Result<std::unique_ptr<StagedFile>> StagedFile::create(const Url& folder, mode_t mode) {
    auto opened = PublishedTrees::openFolder(folder, O_PATH);
    if (!opened.ok())
        return opened.error();
    int folderFd = opened.value();
    FileSystem& fs = FileSystem::current();
    for (int attempt = 0; attempt < 100; ++attempt) {
        std::string name = StagingCopies::makeName();
        std::string path = folder.appendingPathComponent(name).path();
        // Recorded before it exists, so that no kill leaves an unrecorded copy.
        StagingCopies::record(path);
        int fd = fs.openat(folderFd, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                           mode & 07777);
        if (fd >= 0)
            return std::unique_ptr<StagedFile>(new StagedFile(folder, folderFd, name, fd));
        int error = errno;
        StagingCopies::forget(path);
        if (error != EEXIST) {
            fs.close(folderFd);
            return Error::posix(error);
        }
    }
    fs.close(folderFd);
    return Error::posix(EEXIST);
}

StagedFile::StagedFile(Url folder, int folderFd, std::string name, int fd)
    : folder_(std::move(folder)), folderFd_(folderFd), name_(std::move(name)), fd_(fd) {}

StagedFile::~StagedFile() {
    discard();
    FileSystem::current().close(folderFd_);
}

Status StagedFile::write(const void* data, size_t size) {
    if (failed_ || fd_ < 0)
        return Error::posix(EBADF);
    FileSystem& fs = FileSystem::current();
    const char* bytes = static_cast<const char*>(data);
    while (size > 0) {
        ssize_t n = fs.write(fd_, bytes, size);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            failed_ = true;
            return n < 0 ? errnoError() : Error::posix(EIO);
        }
        bytes += n;
        size -= static_cast<size_t>(n);
        size_ += static_cast<uint64_t>(n);
    }
    return Status::OK();
}

Status StagedFile::flush() {
    if (failed_ || fd_ < 0)
        return Error::posix(EBADF);
    FileSystem& fs = FileSystem::current();
    // The rename that follows must never publish a name whose bytes are not on disk yet.
    if (fs.fsync(fd_) != 0) {
        failed_ = true;
        return errnoError();
    }
    int fd = fd_;
    fd_ = -1;
    if (fs.close(fd) != 0) {
        failed_ = true;
        return errnoError();
    }
    return Status::OK();
}

Result<Url> StagedFile::place(const std::string& name) {
    if (auto bad = checkItemName(name); !bad.ok()) {
        discard();
        return bad.error();
    }
    if (auto flushed = flush(); !flushed.ok()) {
        discard();
        return flushed.error();
    }
    Result<Url> placed = Error::posix(EIO);
    pt_placeUnderFolder(folder_.appendingPathComponent(name_), folder_, name,
                        [&](Result<Url> url) { placed = std::move(url); });
    if (!placed.ok()) {
        discard();
        return placed.error();
    }
    forget();
    return placed;
}

Status StagedFile::copyAttributesFrom(const std::string& name) {
    FileSystem& fs = FileSystem::current();
    struct statx st {};
    if (fs.statx(folderFd_, name, AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_MODE, &st) != 0)
        return errnoError();
    if (S_ISDIR(st.stx_mode))
        return Error::posix(EISDIR);
    if (!S_ISREG(st.stx_mode))
        return Error::posix(ELOOP);
    const std::string from = folder_.appendingPathComponent(name).path();
    const std::string to = folder_.appendingPathComponent(name_).path();
    if (fs.chmod(to, st.stx_mode & 07777) != 0)
        return errnoError();

    // Tags, ranks, last-used dates and the rest live in extended attributes: the new content
    // must carry them, or the save would look like a new document.
    ssize_t listSize = fs.llistxattr(from, nullptr, 0);
    if (listSize < 0)
        return errno == ENOTSUP ? Status::OK() : Status(errnoError());
    std::vector<char> list(static_cast<size_t>(listSize) + 1);
    listSize = fs.llistxattr(from, list.data(), list.size());
    if (listSize < 0)
        return errnoError();
    // Opened for the attribute writes only: the content was flushed and closed before.
    int fd = fs.openat(folderFd_, name_, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0)
        return errnoError();
    Status status;
    for (size_t start = 0; start < static_cast<size_t>(listSize) && status.ok();) {
        std::string attribute(list.data() + start);
        start += attribute.size() + 1;
        if (attribute.empty())
            continue;
        ssize_t valueSize = fs.lgetxattr(from, attribute, nullptr, 0);
        if (valueSize < 0) {
            if (errno != ENODATA)  // removed meanwhile
                status = errnoError();
            continue;
        }
        std::vector<char> value(static_cast<size_t>(valueSize));
        valueSize = fs.lgetxattr(from, attribute, value.data(), value.size());
        if (valueSize < 0 ||
            fs.fsetxattr(fd, attribute, value.data(), static_cast<size_t>(valueSize), 0) != 0)
            status = errnoError();
    }
    fs.close(fd);
    return status;
}

Result<Url> StagedFile::replace(const std::string& name) {
    if (auto bad = checkItemName(name); !bad.ok()) {
        discard();
        return bad.error();
    }
    Status ready = flush();
    if (ready.ok())
        ready = copyAttributesFrom(name);
    if (ready.ok() && FileSystem::current().renameat2(folderFd_, name_, folderFd_, name, 0) != 0)
        ready = errnoError();
    if (!ready.ok()) {
        discard();
        return ready.error();
    }
    forget();
    return folder_.appendingPathComponent(name);
}

void StagedFile::discard() {
    if (settled_)
        return;
    FileSystem& fs = FileSystem::current();
    if (fd_ >= 0) {
        fs.close(fd_);
        fd_ = -1;
    }
    fs.unlinkat(folderFd_, name_, 0);
    forget();
}

void StagedFile::forget() {
    settled_ = true;
    StagingCopies::forget(folder_.appendingPathComponent(name_).path());
}

}  // namespace tamber
