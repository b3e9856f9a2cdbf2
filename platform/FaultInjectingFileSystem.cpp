#include "platform/FaultInjectingFileSystem.h"
#include "support/MutexLock.h"

#include <unistd.h>

#include <cerrno>
#include <climits>

namespace tamber {

namespace {

std::string descriptorPath(int fd) {
    std::string link = "/proc/self/fd/" + std::to_string(fd);
    char buffer[PATH_MAX];
    ssize_t n = ::readlink(link.c_str(), buffer, sizeof buffer);
    return n < 0 ? std::string() : std::string(buffer, static_cast<size_t>(n));
}

}  // namespace

std::string_view FaultInjectingFileSystem::operationName(Operation op) {
    switch (op) {
        case Operation::Open:
            return "open";
        case Operation::Openat:
            return "openat";
        case Operation::Close:
            return "close";
        case Operation::Statx:
            return "statx";
        case Operation::Faccessat:
            return "faccessat";
        case Operation::Lgetxattr:
            return "lgetxattr";
        case Operation::Llistxattr:
            return "llistxattr";
        case Operation::Fsetxattr:
            return "fsetxattr";
        case Operation::Fremovexattr:
            return "fremovexattr";
        case Operation::ReadDirectory:
            return "readDirectory";
        case Operation::Mkdir:
            return "mkdir";
        case Operation::Read:
            return "read";
        case Operation::Write:
            return "write";
        case Operation::Fsync:
            return "fsync";
        case Operation::Renameat2:
            return "renameat2";
        case Operation::Unlinkat:
            return "unlinkat";
        case Operation::Statvfs:
            return "statvfs";
        case Operation::Mkdirat:
            return "mkdirat";
        case Operation::CopyFileRange:
            return "copy_file_range";
        case Operation::Readlinkat:
            return "readlinkat";
        case Operation::Symlinkat:
            return "symlinkat";
        case Operation::Chmod:
            return "chmod";
        case Operation::OpenBeneath:
            return "openBeneath";
    }
    return "unknown";
}

FaultInjectingFileSystem::FaultInjectingFileSystem(std::shared_ptr<FileSystem> inner)
    : inner_(std::move(inner)) {}

void FaultInjectingFileSystem::inject(Operation op, int errnoValue, int times,
                                      std::string pathSubstring) {
    if (times == 0)
        return;
    MutexLock lock(mutex_);
    injections_.push_back({op, errnoValue, times, std::move(pathSubstring)});
}

void FaultInjectingFileSystem::injectAfter(Operation op, int errnoValue, int pass,
                                           std::string pathSubstring) {
    MutexLock lock(mutex_);
    injections_.push_back({op, errnoValue, 1, std::move(pathSubstring), pass});
}

void FaultInjectingFileSystem::onlyOnThread(std::optional<std::thread::id> thread) {
    MutexLock lock(mutex_);
    thread_ = thread;
}

void FaultInjectingFileSystem::clearInjections() {
    MutexLock lock(mutex_);
    injections_.clear();
}

size_t FaultInjectingFileSystem::pendingInjections() const {
    MutexLock lock(mutex_);
    size_t pending = 0;
    for (const Injection& injection : injections_) {
        pending += injection.remaining < 0 ? 1 : static_cast<size_t>(injection.remaining);
    }
    return pending;
}

size_t FaultInjectingFileSystem::calls(Operation op) const {
    return calls_[static_cast<size_t>(op)].load();
}

void FaultInjectingFileSystem::resetCalls() {
    for (auto& count : calls_) count.store(0);
}

std::string FaultInjectingFileSystem::describe(const Subject& subject) {
    if (subject.path.starts_with('/'))
        return std::string(subject.path);
    std::string base;
    if (subject.fd >= 0) {
        base = descriptorPath(subject.fd);
    } else if (subject.fd == AT_FDCWD) {
        char cwd[PATH_MAX];
        if (::getcwd(cwd, sizeof cwd))
            base = cwd;
    }
    if (subject.path.empty())
        return base;
    return base + "/" + std::string(subject.path);
}

bool FaultInjectingFileSystem::shouldFail(Operation op, const Subject& subject) {
    calls_[static_cast<size_t>(op)].fetch_add(1);
    MutexLock lock(mutex_);
    if (thread_ && *thread_ != std::this_thread::get_id())
        return false;
    std::string path;
    bool described = false;
    for (auto it = injections_.begin(); it != injections_.end(); ++it) {
        if (it->op != op)
            continue;
        if (!it->pathSubstring.empty()) {
            if (!described) {
                path = describe(subject);
                described = true;
            }
            if (path.find(it->pathSubstring) == std::string::npos)
                continue;
        }
        if (it->pass > 0) {
            --it->pass;
            return false;
        }
        int errnoValue = it->errnoValue;
        if (it->remaining > 0 && --it->remaining == 0)
            injections_.erase(it);
        errno = errnoValue;
        return true;
    }
    return false;
}

int FaultInjectingFileSystem::open(const std::string& path, int flags, mode_t mode) {
    if (shouldFail(Operation::Open, {AT_FDCWD, path}))
        return -1;
    return inner_->open(path, flags, mode);
}

int FaultInjectingFileSystem::openat(int dirfd, const std::string& name, int flags, mode_t mode) {
    if (shouldFail(Operation::Openat, {dirfd, name}))
        return -1;
    return inner_->openat(dirfd, name, flags, mode);
}

int FaultInjectingFileSystem::openBeneath(int dirfd, const std::string& path, int flags,
                                          mode_t mode) {
    if (shouldFail(Operation::OpenBeneath, {dirfd, path}))
        return -1;
    return inner_->openBeneath(dirfd, path, flags, mode);
}

int FaultInjectingFileSystem::close(int fd) {
    if (shouldFail(Operation::Close, {fd, {}}))
        return -1;
    return inner_->close(fd);
}

int FaultInjectingFileSystem::statx(int dirfd, const std::string& path, int flags,
                                    unsigned int mask, struct statx* out) {
    if (shouldFail(Operation::Statx, {dirfd, path}))
        return -1;
    return inner_->statx(dirfd, path, flags, mask, out);
}

int FaultInjectingFileSystem::faccessat(int dirfd, const std::string& path, int mode, int flags) {
    if (shouldFail(Operation::Faccessat, {dirfd, path}))
        return -1;
    return inner_->faccessat(dirfd, path, mode, flags);
}

ssize_t FaultInjectingFileSystem::lgetxattr(const std::string& path, const std::string& name,
                                            void* value, size_t size) {
    if (shouldFail(Operation::Lgetxattr, {AT_FDCWD, path}))
        return -1;
    return inner_->lgetxattr(path, name, value, size);
}

ssize_t FaultInjectingFileSystem::llistxattr(const std::string& path, char* list, size_t size) {
    if (shouldFail(Operation::Llistxattr, {AT_FDCWD, path}))
        return -1;
    return inner_->llistxattr(path, list, size);
}

ssize_t FaultInjectingFileSystem::llistxattrAt(int dirfd, const std::string& name,
                                               const std::string& path, char* list, size_t size) {
    // Faults are aimed by path, whichever way the file is reached.
    if (shouldFail(Operation::Llistxattr, {AT_FDCWD, path}))
        return -1;
    return inner_->llistxattrAt(dirfd, name, path, list, size);
}

int FaultInjectingFileSystem::fsetxattr(int fd, const std::string& name, const void* value,
                                        size_t size, int flags) {
    if (shouldFail(Operation::Fsetxattr, {fd, {}}))
        return -1;
    return inner_->fsetxattr(fd, name, value, size, flags);
}

int FaultInjectingFileSystem::fremovexattr(int fd, const std::string& name) {
    if (shouldFail(Operation::Fremovexattr, {fd, {}}))
        return -1;
    return inner_->fremovexattr(fd, name);
}

bool FaultInjectingFileSystem::readDirectory(int dirfd, std::vector<DirectoryEntry>& out) {
    if (shouldFail(Operation::ReadDirectory, {dirfd, {}}))
        return false;
    return inner_->readDirectory(dirfd, out);
}

int FaultInjectingFileSystem::mkdir(const std::string& path, mode_t mode) {
    if (shouldFail(Operation::Mkdir, {AT_FDCWD, path}))
        return -1;
    return inner_->mkdir(path, mode);
}

int FaultInjectingFileSystem::chmod(const std::string& path, mode_t mode) {
    if (shouldFail(Operation::Chmod, {AT_FDCWD, path}))
        return -1;
    return inner_->chmod(path, mode);
}

ssize_t FaultInjectingFileSystem::read(int fd, void* buffer, size_t size) {
    if (shouldFail(Operation::Read, {fd, {}}))
        return -1;
    return inner_->read(fd, buffer, size);
}

ssize_t FaultInjectingFileSystem::pread(int fd, void* buffer, size_t size, off_t offset) {
    if (shouldFail(Operation::Read, {fd, {}}))
        return -1;
    return inner_->pread(fd, buffer, size, offset);
}

ssize_t FaultInjectingFileSystem::write(int fd, const void* buffer, size_t size) {
    if (shouldFail(Operation::Write, {fd, {}}))
        return -1;
    return inner_->write(fd, buffer, size);
}

int FaultInjectingFileSystem::fsync(int fd) {
    if (shouldFail(Operation::Fsync, {fd, {}}))
        return -1;
    return inner_->fsync(fd);
}

// Matched against the destination, which is what a test usually means to refuse.
int FaultInjectingFileSystem::renameat2(int olddirfd, const std::string& oldpath, int newdirfd,
                                        const std::string& newpath, unsigned int flags) {
    if (shouldFail(Operation::Renameat2, {newdirfd, newpath}))
        return -1;
    return inner_->renameat2(olddirfd, oldpath, newdirfd, newpath, flags);
}

int FaultInjectingFileSystem::unlinkat(int dirfd, const std::string& path, int flags) {
    if (shouldFail(Operation::Unlinkat, {dirfd, path}))
        return -1;
    return inner_->unlinkat(dirfd, path, flags);
}

int FaultInjectingFileSystem::statvfs(const std::string& path, struct statvfs* out) {
    if (shouldFail(Operation::Statvfs, {AT_FDCWD, path}))
        return -1;
    return inner_->statvfs(path, out);
}

int FaultInjectingFileSystem::mkdirat(int dirfd, const std::string& name, mode_t mode) {
    if (shouldFail(Operation::Mkdirat, {dirfd, name}))
        return -1;
    return inner_->mkdirat(dirfd, name, mode);
}

// Matched against the descriptor written to.
ssize_t FaultInjectingFileSystem::copy_file_range(int fdIn, int fdOut, size_t length) {
    if (shouldFail(Operation::CopyFileRange, {fdOut, {}}))
        return -1;
    return inner_->copy_file_range(fdIn, fdOut, length);
}

ssize_t FaultInjectingFileSystem::readlinkat(int dirfd, const std::string& name, char* buffer,
                                             size_t size) {
    if (shouldFail(Operation::Readlinkat, {dirfd, name}))
        return -1;
    return inner_->readlinkat(dirfd, name, buffer, size);
}

int FaultInjectingFileSystem::symlinkat(const std::string& target, int newdirfd,
                                        const std::string& name) {
    if (shouldFail(Operation::Symlinkat, {newdirfd, name}))
        return -1;
    return inner_->symlinkat(target, newdirfd, name);
}

}  // namespace tamber
