#pragma once

#include <fcntl.h>
#include <linux/stat.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

namespace tamber {

// Every file, attribute and directory call of the program goes through this interface, so that
// tests can inject faults (see FaultInjectingFileSystem). Methods behave like the system calls
// they are named after: -1 (or null/false) with errno set on failure.
//
// Extended attribute names are given without the "user." namespace prefix; only the Linux
// implementation adds and strips it.
class FileSystem {
public:
    virtual ~FileSystem() = default;

    // The process-wide instance (LinuxFileSystem unless a test replaced it).
    static FileSystem& current();
    static std::shared_ptr<FileSystem> currentShared();
    // Replaces the process-wide instance; returns the previous one. Tests only.
    static std::shared_ptr<FileSystem> setCurrent(std::shared_ptr<FileSystem> fs);

    virtual int open(const std::string& path, int flags, mode_t mode = 0) = 0;
    virtual int openat(int dirfd, const std::string& name, int flags, mode_t mode = 0) = 0;
    virtual int close(int fd) = 0;
    // Opens the relative `path` beneath the directory `dirfd` without following a symbolic link
    // in any component, the last one included, and without leaving `dirfd` (no "..", no
    // absolute path): openat2(2) with RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS, or, on a kernel
    // without it, a component-by-component O_NOFOLLOW walk. A link component fails with ELOOP
    // (with O_PATH | O_NOFOLLOW a final link is opened as the link itself), an escape with
    // EXDEV. An empty path or "." opens `dirfd` itself again.
    virtual int openBeneath(int dirfd, const std::string& path, int flags, mode_t mode = 0) = 0;

    // statx(2); `dirfd` AT_FDCWD for absolute paths.
    virtual int statx(int dirfd, const std::string& path, int flags, unsigned int mask,
                      struct statx* out) = 0;
    virtual int faccessat(int dirfd, const std::string& path, int mode, int flags) = 0;

    // lgetxattr(2): never follows a final symbolic link.
    virtual ssize_t lgetxattr(const std::string& path, const std::string& name, void* value,
                              size_t size) = 0;
    // llistxattr(2); the names returned are without the "user." prefix, and names of other
    // namespaces are left out.
    virtual ssize_t llistxattr(const std::string& path, char* list, size_t size) = 0;
    // The same for the entry `name` of the open folder `dirfd`, which is the file at `path`:
    // one name lookup instead of a walk of the path (the path serves kernels that have no such
    // call).
    virtual ssize_t llistxattrAt(int dirfd, const std::string& name, const std::string& path,
                                 char* list, size_t size) = 0;
    virtual int fsetxattr(int fd, const std::string& name, const void* value, size_t size,
                          int flags) = 0;
    virtual int fremovexattr(int fd, const std::string& name) = 0;

    struct DirectoryEntry {
        std::string name;
        unsigned char type;  // DT_* from getdents64; DT_UNKNOWN when the file system does not say
        ino_t inode;
    };
    // All entries of an open directory except "." and "..", sorted by name (byte order).
    // Returns false with errno set on failure.
    virtual bool readDirectory(int dirfd, std::vector<DirectoryEntry>& out) = 0;

    virtual int mkdir(const std::string& path, mode_t mode) = 0;
    // fchmodat(2) on a path, following no symbolic link at its end.
    virtual int chmod(const std::string& path, mode_t mode) = 0;

    virtual ssize_t read(int fd, void* buffer, size_t size) = 0;
    virtual ssize_t write(int fd, const void* buffer, size_t size) = 0;
    // pread(2): reads at `offset` without moving the descriptor's offset, so that ranges of one
    // open file can be served in any order. The base answers ENOSYS (file systems of tests that
    // never serve content need not have it).
    virtual ssize_t pread(int fd, void* buffer, size_t size, off_t offset);
    virtual int fsync(int fd) = 0;
    // renameat2(2); `flags` 0 or RENAME_NOREPLACE / RENAME_EXCHANGE.
    virtual int renameat2(int olddirfd, const std::string& oldpath, int newdirfd,
                          const std::string& newpath, unsigned int flags) = 0;
    virtual int unlinkat(int dirfd, const std::string& path, int flags) = 0;
    virtual int statvfs(const std::string& path, struct statvfs* out) = 0;

    virtual int mkdirat(int dirfd, const std::string& name, mode_t mode) = 0;
    // copy_file_range(2) from each descriptor's current offset (which both advance).
    virtual ssize_t copy_file_range(int fdIn, int fdOut, size_t length) = 0;
    // readlinkat(2): the target, not NUL-terminated, truncated to `size`.
    virtual ssize_t readlinkat(int dirfd, const std::string& name, char* buffer, size_t size) = 0;
    virtual int symlinkat(const std::string& target, int newdirfd, const std::string& name) = 0;
};

}  // namespace tamber
