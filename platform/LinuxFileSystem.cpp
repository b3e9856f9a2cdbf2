#include "platform/LinuxFileSystem.h"

#include <linux/openat2.h>
#include <stdio.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string_view>

namespace tamber {

namespace {

constexpr std::string_view kUserPrefix = "user.";

std::string userName(const std::string& name) {
    std::string full;
    full.reserve(kUserPrefix.size() + name.size());
    full.append(kUserPrefix).append(name);
    return full;
}

// Offsets in a getdents64 record (struct linux_dirent64): inode, next offset, record length,
// type, then the NUL-terminated name.
constexpr size_t kInodeOffset = 0;
constexpr size_t kLengthOffset = 16;
constexpr size_t kTypeOffset = 18;
constexpr size_t kNameOffset = 19;

// Reads every entry of `fd` from its current offset to the end.
bool readAllEntries(int fd, std::vector<FileSystem::DirectoryEntry>& out) {
    alignas(8) char buffer[32 * 1024];
    for (;;) {
        long n = ::syscall(SYS_getdents64, fd, buffer, sizeof buffer);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return false;
        }
        if (n == 0)
            return true;
        for (long pos = 0; pos < n;) {
            const char* record = buffer + pos;
            uint64_t inode;
            unsigned short length;
            std::memcpy(&inode, record + kInodeOffset, sizeof inode);
            std::memcpy(&length, record + kLengthOffset, sizeof length);
            auto type = static_cast<unsigned char>(record[kTypeOffset]);
            std::string_view name(record + kNameOffset);
            pos += length;
            if (name == "." || name == "..")
                continue;
            out.push_back({std::string(name), type, static_cast<ino_t>(inode)});
        }
    }
}

// The components of a relative path without empty and "." ones; nothing (errno EXDEV) for an
// absolute path or one with "..", which could only lead out of or around the directory.
std::optional<std::vector<std::string>> beneathComponents(const std::string& path) {
    if (path.starts_with('/')) {
        errno = EXDEV;
        return std::nullopt;
    }
    std::vector<std::string> components;
    size_t start = 0;
    while (start <= path.size()) {
        size_t slash = path.find('/', start);
        if (slash == std::string::npos)
            slash = path.size();
        std::string component = path.substr(start, slash - start);
        start = slash + 1;
        if (component.empty() || component == ".")
            continue;
        if (component == "..") {
            errno = EXDEV;
            return std::nullopt;
        }
        components.push_back(std::move(component));
    }
    return components;
}

bool isLinkAt(int dirfd, const std::string& name) {
    struct stat st {};
    return ::fstatat(dirfd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(st.st_mode);
}

}  // namespace

int LinuxFileSystem::openBeneath(int dirfd, const std::string& path, int flags, mode_t mode) {
    auto components = beneathComponents(path);
    if (!components)
        return -1;
    if (resolution_ == BeneathResolution::Walk || openat2Missing_.load())
        return walkBeneath(dirfd, path, flags, mode);
    struct open_how how {};
    how.flags = static_cast<uint64_t>(flags | O_CLOEXEC);
    how.mode = (flags & (O_CREAT | O_TMPFILE)) ? mode : 0;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
    std::string relative = components->empty() ? std::string(".") : path;
    // EAGAIN: a rename elsewhere raced the lookup; the kernel asks to try again.
    for (int attempt = 0;; ++attempt) {
        long fd = openat2(dirfd, relative.c_str(), &how, sizeof how);
        if (fd >= 0)
            return static_cast<int>(fd);
        if (errno == ENOSYS) {
            openat2Missing_.store(true);
            return walkBeneath(dirfd, path, flags, mode);
        }
        if (errno != EAGAIN || attempt == 16)
            return -1;
    }
}

long LinuxFileSystem::openat2(int dirfd, const char* path, void* how, size_t size) {
    return ::syscall(SYS_openat2, dirfd, path, how, size);
}

int LinuxFileSystem::walkBeneath(int dirfd, const std::string& path, int flags, mode_t mode) {
    auto components = beneathComponents(path);
    if (!components)
        return -1;
    if (components->empty())
        return ::openat(dirfd, ".", flags | O_CLOEXEC, mode);
    int current = dirfd;
    auto release = [&] {
        if (current != dirfd) {
            int saved = errno;
            ::close(current);
            errno = saved;
        }
    };
    for (size_t i = 0; i + 1 < components->size(); ++i) {
        const std::string& name = (*components)[i];
        int next = ::openat(current, name.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        if (next < 0) {
            // O_NOFOLLOW | O_PATH opens a link as such, and O_DIRECTORY then refuses it.
            if (errno == ENOTDIR && isLinkAt(current, name))
                errno = ELOOP;
            release();
            return -1;
        }
        release();
        current = next;
    }
    const std::string& last = components->back();
    // A final link is opened as the link only when the caller asked for exactly that.
    bool linkWanted = (flags & O_PATH) && (flags & O_NOFOLLOW);
    if (!linkWanted && isLinkAt(current, last)) {
        errno = ELOOP;
        release();
        return -1;
    }
    int fd = ::openat(current, last.c_str(), flags | O_NOFOLLOW | O_CLOEXEC, mode);
    if (fd < 0 && errno == ENOTDIR && isLinkAt(current, last))
        errno = ELOOP;
    release();
    return fd;
}

int LinuxFileSystem::open(const std::string& path, int flags, mode_t mode) {
    return ::open(path.c_str(), flags | O_CLOEXEC, mode);
}

int LinuxFileSystem::openat(int dirfd, const std::string& name, int flags, mode_t mode) {
    return ::openat(dirfd, name.c_str(), flags | O_CLOEXEC, mode);
}

int LinuxFileSystem::close(int fd) {
    return ::close(fd);
}

int LinuxFileSystem::statx(int dirfd, const std::string& path, int flags, unsigned int mask,
                           struct statx* out) {
    return ::statx(dirfd, path.c_str(), flags, mask, out);
}

int LinuxFileSystem::faccessat(int dirfd, const std::string& path, int mode, int flags) {
    return ::faccessat(dirfd, path.c_str(), mode, flags);
}

ssize_t LinuxFileSystem::lgetxattr(const std::string& path, const std::string& name, void* value,
                                   size_t size) {
    return ::lgetxattr(path.c_str(), userName(name).c_str(), value, size);
}

namespace {

// listxattrat(2), Linux 6.13 and later; the number is the same on every architecture.
constexpr long kListxattrat = 465;
std::atomic<bool> gNoListxattrat{false};

// The kernel's attribute list of one file through `list(buffer, size)`, then only the user
// names, without their prefix, into the caller's buffer. Most files have no attributes or a
// few short ones: the first read goes into a buffer on the stack, and only a longer list costs
// the call that asks for its size.
template <class ListCall>
ssize_t userNames(const ListCall& listRaw, char* list, size_t size) {
    char small[1024];
    std::vector<char> large;
    const char* raw = small;
    ssize_t got = listRaw(small, sizeof small);
    // The list may grow between asking its size and reading it, hence the loop.
    while (got < 0 && errno == ERANGE) {
        ssize_t needed = listRaw(nullptr, 0);
        if (needed < 0)
            return -1;
        large.resize(static_cast<size_t>(needed) + 1);
        got = listRaw(large.data(), large.size());
        raw = large.data();
    }
    if (got < 0)
        return -1;

    std::string names;
    const size_t length = static_cast<size_t>(got);
    for (size_t pos = 0; pos < length;) {
        const char* start = raw + pos;
        size_t nameLength = ::strnlen(start, length - pos);
        std::string_view name(start, nameLength);
        pos += nameLength + 1;
        if (name.size() > kUserPrefix.size() && name.starts_with(kUserPrefix)) {
            names.append(name.substr(kUserPrefix.size()));
            names.push_back('\0');
        }
    }
    if (size == 0)
        return static_cast<ssize_t>(names.size());
    if (size < names.size()) {
        errno = ERANGE;
        return -1;
    }
    std::memcpy(list, names.data(), names.size());
    return static_cast<ssize_t>(names.size());
}

}  // namespace

ssize_t LinuxFileSystem::llistxattr(const std::string& path, char* list, size_t size) {
    return userNames(
        [&](char* buffer, size_t length) { return ::llistxattr(path.c_str(), buffer, length); },
        list, size);
}

ssize_t LinuxFileSystem::llistxattrAt(int dirfd, const std::string& name, const std::string& path,
                                      char* list, size_t size) {
    if (!gNoListxattrat.load(std::memory_order_relaxed)) {
        ssize_t got = userNames(
            [&](char* buffer, size_t length) {
                return static_cast<ssize_t>(::syscall(kListxattrat, dirfd, name.c_str(),
                                                      AT_SYMLINK_NOFOLLOW, buffer, length));
            },
            list, size);
        if (got >= 0 || errno != ENOSYS)
            return got;
        gNoListxattrat.store(true, std::memory_order_relaxed);
    }
    return llistxattr(path, list, size);
}

int LinuxFileSystem::fsetxattr(int fd, const std::string& name, const void* value, size_t size,
                               int flags) {
    return ::fsetxattr(fd, userName(name).c_str(), value, size, flags);
}

int LinuxFileSystem::fremovexattr(int fd, const std::string& name) {
    return ::fremovexattr(fd, userName(name).c_str());
}

bool LinuxFileSystem::readDirectory(int dirfd, std::vector<DirectoryEntry>& out) {
    out.clear();
    // A description of our own leaves the caller's offset alone. Opening "." needs search
    // permission, which a readable directory may lack; then read the caller's fd from the start.
    int own = ::openat(dirfd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    bool ok;
    if (own >= 0) {
        ok = readAllEntries(own, out);
        int saved = errno;
        ::close(own);
        errno = saved;
    } else {
        if (::lseek(dirfd, 0, SEEK_SET) < 0)
            return false;
        ok = readAllEntries(dirfd, out);
    }
    if (!ok) {
        int saved = errno;
        out.clear();
        errno = saved;
        return false;
    }
    std::sort(out.begin(), out.end(),
              [](const DirectoryEntry& a, const DirectoryEntry& b) { return a.name < b.name; });
    return true;
}

int LinuxFileSystem::mkdir(const std::string& path, mode_t mode) {
    return ::mkdir(path.c_str(), mode);
}

ssize_t LinuxFileSystem::read(int fd, void* buffer, size_t size) {
    return ::read(fd, buffer, size);
}

ssize_t LinuxFileSystem::pread(int fd, void* buffer, size_t size, off_t offset) {
    return ::pread(fd, buffer, size, offset);
}

ssize_t LinuxFileSystem::write(int fd, const void* buffer, size_t size) {
    return ::write(fd, buffer, size);
}

int LinuxFileSystem::fsync(int fd) {
    return ::fsync(fd);
}

int LinuxFileSystem::renameat2(int olddirfd, const std::string& oldpath, int newdirfd,
                               const std::string& newpath, unsigned int flags) {
    return ::renameat2(olddirfd, oldpath.c_str(), newdirfd, newpath.c_str(), flags);
}

int LinuxFileSystem::unlinkat(int dirfd, const std::string& path, int flags) {
    return ::unlinkat(dirfd, path.c_str(), flags);
}

int LinuxFileSystem::statvfs(const std::string& path, struct statvfs* out) {
    return ::statvfs(path.c_str(), out);
}

int LinuxFileSystem::mkdirat(int dirfd, const std::string& name, mode_t mode) {
    return ::mkdirat(dirfd, name.c_str(), mode);
}

int LinuxFileSystem::chmod(const std::string& path, mode_t mode) {
    // Linux refuses AT_SYMLINK_NOFOLLOW here; a link's own mode cannot be changed, so check.
    struct stat st;
    if (::lstat(path.c_str(), &st) != 0)
        return -1;
    if (S_ISLNK(st.st_mode)) {
        errno = ELOOP;
        return -1;
    }
    return ::fchmodat(AT_FDCWD, path.c_str(), mode, 0);
}

ssize_t LinuxFileSystem::copy_file_range(int fdIn, int fdOut, size_t length) {
    return ::copy_file_range(fdIn, nullptr, fdOut, nullptr, length, 0);
}

ssize_t LinuxFileSystem::readlinkat(int dirfd, const std::string& name, char* buffer, size_t size) {
    return ::readlinkat(dirfd, name.c_str(), buffer, size);
}

int LinuxFileSystem::symlinkat(const std::string& target, int newdirfd, const std::string& name) {
    return ::symlinkat(target.c_str(), newdirfd, name.c_str());
}

}  // namespace tamber
