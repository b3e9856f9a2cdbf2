#include "host/FileTree.h"

#include <dirent.h>

#include <cerrno>
#include <climits>
#include <functional>
#include <vector>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"

namespace tamber::filetree {

namespace {

Error lastError() {
    return Error::errorWithPOSIXCode(errno);
}

}  // namespace

std::optional<ItemType> itemTypeAt(int dirfd, const std::string& name) {
    struct statx st {};
    if (FileSystem::current().statx(dirfd, name, AT_SYMLINK_NOFOLLOW,
                                    STATX_TYPE | STATX_MODE | STATX_INO, &st) != 0)
        return std::nullopt;
    return ItemType{st.stx_mode, (uint64_t(st.stx_dev_major) << 32) | st.stx_dev_minor, st.stx_ino};
}

// Walks through descriptors opened without following links, so that a link found inside is
// removed as a link and never entered.
Status removeItem(int dirfd, const std::string& name) {
    FileSystem& fs = FileSystem::current();
    auto type = itemTypeAt(dirfd, name);
    if (!type)
        return lastError();
    if (!S_ISDIR(type->mode)) {
        if (fs.unlinkat(dirfd, name, 0) != 0)
            return lastError();
        return Status::OK();
    }

    struct Frame {
        ScopedFd fd;
        std::string name;  // in the folder below it on the stack (or `dirfd`)
        std::vector<FileSystem::DirectoryEntry> entries;
        size_t next = 0;
    };
    // The folders open on the way down; whatever is left closes when the walk returns.
    std::vector<Frame> stack;
    // Opens a folder and reads it; false with errno set when either fails.
    auto enter = [&](int parent, const std::string& child) {
        ScopedFd fd(fs.openat(parent, child, O_RDONLY | O_DIRECTORY | O_NOFOLLOW));
        if (!fd.ok())
            return false;
        std::vector<FileSystem::DirectoryEntry> entries;
        if (!fs.readDirectory(fd.get(), entries))
            return false;
        stack.push_back({std::move(fd), child, std::move(entries)});
        return true;
    };

    if (!enter(dirfd, name))
        return lastError();
    while (!stack.empty()) {
        Frame& top = stack.back();
        if (top.next == top.entries.size()) {
            std::string done = std::move(top.name);
            stack.pop_back();
            int parent = stack.empty() ? dirfd : stack.back().fd.get();
            if (fs.unlinkat(parent, done, AT_REMOVEDIR) == 0)
                continue;
            const int code = errno;
            if (code != ENOENT)
                return Error::errorWithPOSIXCode(code);
            // ENOENT is another delete winning the race; for the item asked for, it is only
            // believed when the folder is really gone.
            if (stack.empty()) {
                auto still = itemTypeAt(dirfd, name);
                if (still && still->device == type->device && still->inode == type->inode)
                    return Error::errorWithPOSIXCode(code);
            }
            continue;
        }
        const FileSystem::DirectoryEntry& entry = top.entries[top.next++];
        int parent = top.fd.get();
        bool isDirectory = entry.type == DT_DIR;
        if (entry.type == DT_UNKNOWN) {
            auto entryType = itemTypeAt(parent, entry.name);
            isDirectory = entryType && S_ISDIR(entryType->mode);
        }
        std::string child = entry.name;  // `entry` dies when a frame is pushed
        if (isDirectory && enter(parent, child))
            continue;
        // Not a folder, or no longer one (replaced by a link or a file since it was listed).
        if (isDirectory && errno != ENOTDIR && errno != ELOOP && errno != ENOENT) {
            Error error = lastError();
            return error;
        }
        if (fs.unlinkat(parent, child, 0) != 0 && errno != ENOENT) {
            Error error = lastError();
            return error;
        }
    }
    return Status::OK();
}

// Copies the bytes of one open file into another, in the kernel when it can, else by reading
// and writing (file systems and kernels that refuse copy_file_range between them).
static Status copyBytes(int in, int out) {
    FileSystem& fs = FileSystem::current();
    for (;;) {
        ssize_t n = fs.copy_file_range(in, out, size_t(1) << 30);
        if (n > 0)
            continue;
        if (n == 0)
            return Status::OK();
        if (errno == EINTR)
            continue;
        if (errno != EXDEV && errno != EINVAL && errno != ENOSYS && errno != EOPNOTSUPP)
            return lastError();
        break;
    }
    std::vector<char> buffer(128 * 1024);
    for (;;) {
        ssize_t n = fs.read(in, buffer.data(), buffer.size());
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return lastError();
        if (n == 0)
            return Status::OK();
        for (ssize_t done = 0; done < n;) {
            ssize_t w = fs.write(out, buffer.data() + done, size_t(n - done));
            if (w < 0 && errno == EINTR)
                continue;
            if (w < 0)
                return lastError();
            done += w;
        }
    }
}

// Copies a file's bytes into `out` and makes them durable, so that a crash after the copy is
// renamed into place cannot publish an empty or partial file.
Status copyFileInto(int fromDir, const std::string& from, int out) {
    FileSystem& fs = FileSystem::current();
    // Non-blocking in case a pipe took the file's place since it was looked at.
    ScopedFd in(fs.openat(fromDir, from, O_RDONLY | O_NOFOLLOW | O_NONBLOCK));
    if (!in.ok())
        return lastError();
    if (Status copied = copyBytes(in.get(), out); !copied.ok())
        return copied;
    if (fs.fsync(out) != 0)
        return lastError();
    return Status::OK();
}

// Imported documents stay editable by their owner, whatever the source allowed.
mode_t copyMode(mode_t mode) {
    return (mode & 0777) | S_IWUSR;
}

static Status copyFile(int fromDir, const std::string& from, int toDir, const std::string& to,
                       mode_t mode) {
    ScopedFd out(FileSystem::current().openat(toDir, to, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW,
                                              copyMode(mode)));
    if (!out.ok())
        return lastError();
    return copyFileInto(fromDir, from, out.get());
}

Result<std::string> readLink(int dirfd, const std::string& name) {
    std::string target(PATH_MAX, '\0');
    ssize_t n = FileSystem::current().readlinkat(dirfd, name, target.data(), target.size());
    if (n < 0)
        return lastError();
    if (size_t(n) == target.size())
        return Error::posix(ENAMETOOLONG);  // possibly cut short
    target.resize(size_t(n));
    return target;
}

static Status copyLink(int fromDir, const std::string& from, int toDir, const std::string& to) {
    auto target = readLink(fromDir, from);
    if (!target.ok())
        return target.error();
    if (FileSystem::current().symlinkat(*target, toDir, to) != 0)
        return lastError();
    return Status::OK();
}

// Copies what the folder `from` of `fromDir` holds into the existing empty folder `to` of
// `toDir`: folders, files and links; other kinds of file (pipes, sockets, devices) are left
// out. When the copy is made inside the folder being copied, the walk leaves the copy out.
Status copyFolderInto(int fromDir, const std::string& from, int toDir, const std::string& to) {
    FileSystem& fs = FileSystem::current();
    struct Frame {
        ScopedFd from;
        ScopedFd to;
        std::vector<FileSystem::DirectoryEntry> entries;
        size_t next = 0;
    };
    // The folders open on both sides; whatever is left closes when the walk returns.
    std::vector<Frame> stack;
    // Opens both sides of one folder (making the copy unless `create` is null); false with
    // errno set.
    auto enter = [&](int parentFrom, const std::string& name, int parentTo,
                     const std::string& copyName, std::optional<mode_t> create) {
        if (create && fs.mkdirat(parentTo, copyName, copyMode(*create) | S_IRWXU) != 0)
            return false;
        ScopedFd in(fs.openat(parentFrom, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW));
        ScopedFd out(!in.ok() ? -1
                              : fs.openat(parentTo, copyName, O_PATH | O_DIRECTORY | O_NOFOLLOW));
        std::vector<FileSystem::DirectoryEntry> entries;
        if (!out.ok() || !fs.readDirectory(in.get(), entries))
            return false;
        stack.push_back({std::move(in), std::move(out), std::move(entries)});
        return true;
    };

    if (!enter(fromDir, from, toDir, to, std::nullopt))
        return lastError();
    std::optional<ItemType> copyRoot = itemTypeAt(toDir, to);
    while (!stack.empty()) {
        Frame& top = stack.back();
        if (top.next == top.entries.size()) {
            stack.pop_back();
            continue;
        }
        std::string name = top.entries[top.next++].name;
        int in = top.from.get();
        int out = top.to.get();
        auto type = itemTypeAt(in, name);
        Status failure;
        if (!type) {
            if (errno == ENOENT)
                continue;  // removed while we copied
            failure = lastError();
        } else if (S_ISDIR(type->mode)) {
            if (copyRoot && type->device == copyRoot->device && type->inode == copyRoot->inode)
                continue;
            if (!enter(in, name, out, name, type->mode))
                failure = lastError();
        } else if (S_ISREG(type->mode)) {
            failure = copyFile(in, name, out, name, type->mode);
        } else if (S_ISLNK(type->mode)) {
            failure = copyLink(in, name, out, name);
        }
        if (!failure.ok()) {
            return failure;
        }
    }
    return Status::OK();
}

}  // namespace tamber::filetree
