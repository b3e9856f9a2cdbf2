#include "platform/FileContents.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <random>
#include <string>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"

namespace tamber {

namespace {

constexpr size_t kReadChunk = 64 * 1024;
// Names already taken by another writer are retried with a fresh suffix this many times.
constexpr int kTemporaryNameAttempts = 16;

bool isDirectory(const std::string& path) {
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, path, 0, STATX_TYPE, &st) != 0)
        return false;
    return S_ISDIR(st.stx_mode);
}

// errno is set on failure.
bool makeDirectories(const std::string& path) {
    FileSystem& fs = FileSystem::current();
    if (fs.mkdir(path, 0777) == 0)
        return true;
    if (errno == EEXIST) {
        if (isDirectory(path))
            return true;
        errno = EEXIST;
        return false;
    }
    if (errno != ENOENT)
        return false;
    Url parent = Url::fileURLWithPath(path).deletingLastPathComponent();
    if (parent.path() == path || !makeDirectories(parent.path()))
        return false;
    // Another process may have made it in the meantime.
    if (fs.mkdir(path, 0777) == 0)
        return true;
    if (errno == EEXIST && isDirectory(path))
        return true;
    return false;
}

std::string temporarySuffix() {
    static std::atomic<uint64_t> counter{0};
    thread_local std::mt19937_64 random{std::random_device{}()};
    return std::to_string(random() % 1000000000) + "-" + std::to_string(counter++);
}

bool writeAll(int fd, const Bytes& bytes) {
    FileSystem& fs = FileSystem::current();
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = fs.write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return false;
        }
        if (n == 0) {
            errno = EIO;
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

}  // namespace

Result<Bytes> FileContents::read(const Url& url) {
    FileSystem& fs = FileSystem::current();
    ScopedFd fd(fs.open(url.path(), O_RDONLY));
    if (!fd.ok()) {
        if (errno == ENOENT)
            return Error::fileNoSuchFile(url.path());
        return Error::errorWithPOSIXCode(errno);
    }
    Bytes bytes;
    for (;;) {
        size_t used = bytes.size();
        bytes.resize(used + kReadChunk);
        ssize_t n = fs.read(fd.get(), bytes.data() + used, kReadChunk);
        if (n < 0) {
            if (errno == EINTR) {
                bytes.resize(used);
                continue;
            }
            Error error = Error::errorWithPOSIXCode(errno);
            return error;
        }
        bytes.resize(used + static_cast<size_t>(n));
        if (n == 0)
            break;
    }
    return bytes;
}

Status FileContents::createDirectory(const Url& url) {
    if (!makeDirectories(url.path()))
        return Error::errorWithPOSIXCode(errno);
    return Status::OK();
}

Status FileContents::writeAtomically(const Url& url, const Bytes& bytes, mode_t mode) {
    FileSystem& fs = FileSystem::current();
    // Hidden, so that a directory listing never shows a half-written file.
    std::string prefix = url.deletingLastPathComponent().path();
    if (prefix.back() != '/')
        prefix += '/';
    prefix += "." + url.lastPathComponent() + ".";

    std::string temporary;
    ScopedFd fd;
    for (int attempt = 0; attempt < kTemporaryNameAttempts && !fd.ok(); ++attempt) {
        temporary = prefix + temporarySuffix();
        fd.reset(fs.open(temporary, O_WRONLY | O_CREAT | O_EXCL, mode));
        if (!fd.ok() && errno != EEXIST)
            return Error::errorWithPOSIXCode(errno);
    }
    if (!fd.ok())
        return Error::errorWithPOSIXCode(errno);

    // A write error may show only when the file is closed: that close is checked too. On the
    // failing path the descriptor is closed keeping the first error.
    bool ok = writeAll(fd.get(), bytes) && fs.fsync(fd.get()) == 0;
    if (!ok)
        fd.reset();
    else if (fd.close() != 0)
        ok = false;
    if (ok && fs.renameat2(AT_FDCWD, temporary, AT_FDCWD, url.path(), 0) == 0)
        return Status::OK();

    Error error = Error::errorWithPOSIXCode(errno);
    fs.unlinkat(AT_FDCWD, temporary, 0);
    return error;
}

}  // namespace tamber
