#pragma once

#include <atomic>

#include "platform/FileSystem.h"

namespace tamber {

// The real system calls. Attribute names gain the "user." prefix here and nowhere else.
class LinuxFileSystem : public FileSystem {
public:
    // Which way openBeneath resolves paths: openat2 when the kernel has it (falling back to the
    // walk on ENOSYS), or always the walk (for tests of the older kernels' path).
    enum class BeneathResolution { Openat2, Walk };
    explicit LinuxFileSystem(BeneathResolution resolution = BeneathResolution::Openat2)
        : resolution_(resolution) {}

    int open(const std::string& path, int flags, mode_t mode) override;
    int openat(int dirfd, const std::string& name, int flags, mode_t mode) override;
    int close(int fd) override;
    int openBeneath(int dirfd, const std::string& path, int flags, mode_t mode) override;
    int statx(int dirfd, const std::string& path, int flags, unsigned int mask,
              struct statx* out) override;
    int faccessat(int dirfd, const std::string& path, int mode, int flags) override;
    ssize_t lgetxattr(const std::string& path, const std::string& name, void* value,
                      size_t size) override;
    ssize_t llistxattr(const std::string& path, char* list, size_t size) override;
    ssize_t llistxattrAt(int dirfd, const std::string& name, const std::string& path, char* list,
                         size_t size) override;
    int fsetxattr(int fd, const std::string& name, const void* value, size_t size,
                  int flags) override;
    int fremovexattr(int fd, const std::string& name) override;
    bool readDirectory(int dirfd, std::vector<DirectoryEntry>& out) override;
    int mkdir(const std::string& path, mode_t mode) override;
    ssize_t read(int fd, void* buffer, size_t size) override;
    ssize_t pread(int fd, void* buffer, size_t size, off_t offset) override;
    ssize_t write(int fd, const void* buffer, size_t size) override;
    int fsync(int fd) override;
    int renameat2(int olddirfd, const std::string& oldpath, int newdirfd,
                  const std::string& newpath, unsigned int flags) override;
    int unlinkat(int dirfd, const std::string& path, int flags) override;
    int statvfs(const std::string& path, struct statvfs* out) override;
    int mkdirat(int dirfd, const std::string& name, mode_t mode) override;
    int chmod(const std::string& path, mode_t mode) override;
    ssize_t copy_file_range(int fdIn, int fdOut, size_t length) override;
    ssize_t readlinkat(int dirfd, const std::string& name, char* buffer, size_t size) override;
    int symlinkat(const std::string& target, int newdirfd, const std::string& name) override;

protected:
    // The openat2(2) system call with its `struct open_how`; tests play a kernel without it.
    virtual long openat2(int dirfd, const char* path, void* how, size_t size);

private:
    int walkBeneath(int dirfd, const std::string& path, int flags, mode_t mode);

    BeneathResolution resolution_;
    // Set once openat2 answered ENOSYS: the walk serves every later call.
    std::atomic<bool> openat2Missing_{false};
};

}  // namespace tamber
