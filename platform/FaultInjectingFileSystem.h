#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/FileSystem.h"
#include "support/Mutex.h"

namespace tamber {

// Forwards every call to another file system, except those a test asked to fail: a failing call
// sets errno and returns the call's failure value without reaching the inner file system.
// Counts every call per operation, failed or not. Safe to use from several threads.
class FaultInjectingFileSystem : public FileSystem {
public:
    enum class Operation {
        Open,
        Openat,
        Close,
        Statx,
        Faccessat,
        Lgetxattr,
        Llistxattr,
        Fsetxattr,
        Fremovexattr,
        ReadDirectory,
        Mkdir,
        Read,
        Write,
        Fsync,
        Renameat2,
        Unlinkat,
        Statvfs,
        Mkdirat,
        CopyFileRange,
        Readlinkat,
        Symlinkat,
        OpenBeneath,
        Chmod,
    };
    static constexpr size_t kOperationCount = static_cast<size_t>(Operation::Chmod) + 1;
    static std::string_view operationName(Operation op);

    explicit FaultInjectingFileSystem(std::shared_ptr<FileSystem> inner);

    // The next `times` calls of `op` whose path contains `pathSubstring` fail with `errnoValue`;
    // `times` < 0 means every such call from now on. For calls that take a descriptor the path
    // is the one the descriptor was opened with (as /proc reports it); for a name relative to a
    // directory descriptor, that directory's path, "/", and the name. An empty substring matches
    // every call. Injections are tried in the order they were made.
    void inject(Operation op, int errnoValue, int times = 1, std::string pathSubstring = "");
    // Lets the next `pass` matching calls of `op` through, then fails one: a fault in the
    // middle of an operation rather than at its first call.
    void injectAfter(Operation op, int errnoValue, int pass, std::string pathSubstring = "");
    void clearInjections();
    // Injections fail only calls made on `thread` (none: calls from any thread), so that a
    // test can fail an operation it runs without failing the threads working beside it.
    void onlyOnThread(std::optional<std::thread::id> thread);
    // Injected failures not yet used up (forever-injections count as one).
    size_t pendingInjections() const;

    // How many calls of `op` were made, including the failed ones.
    size_t calls(Operation op) const;
    void resetCalls();

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
    // Fails with the injections of Read: both read a file's content.
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

private:
    struct Injection {
        Operation op;
        int errnoValue;
        int remaining;
        std::string pathSubstring;
        int pass = 0;  // matching calls let through first
    };
    // A path, or how to build it when an injection needs to look at it.
    struct Subject {
        int fd = -1;  // a descriptor, or the directory of a relative name
        std::string_view path;
    };

    // Counts the call; true (with errno set) when it must fail.
    bool shouldFail(Operation op, const Subject& subject);
    static std::string describe(const Subject& subject);

    std::shared_ptr<FileSystem> inner_;
    std::array<std::atomic<size_t>, kOperationCount> calls_{};
    mutable Mutex mutex_;
    std::vector<Injection> injections_ GUARDED_BY(mutex_);
    std::optional<std::thread::id> thread_ GUARDED_BY(mutex_);
};

}  // namespace tamber
