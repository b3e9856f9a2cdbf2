#include "platform/tremors/TremorStoreDirectory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <thread>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/Log.h"

namespace tamber {

namespace {

Error failure(int code, std::string description) {
    logError(description);
    return Error(kPosixErrorDomain, code, {{"description", std::move(description)}});
}

bool exists(const std::string& path) {
    struct statx st {};
    return FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) == 0;
}

// Like mkdir -p; 0 or the errno value of the first component that could not be made.
int makeDirectories(const std::string& path) {
    FileSystem& fs = FileSystem::current();
    for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
        std::string prefix = path.substr(0, slash);
        if (!prefix.empty() && fs.mkdir(prefix, 0700) != 0 && errno != EEXIST)
            return errno;
        if (slash == std::string::npos)
            return 0;
    }
}

}  // namespace

Result<std::unique_ptr<TremorStoreDirectory>> TremorStoreDirectory::acquire(
    const std::string& stateDir, uint64_t fsid, const LockWait& wait) {
    char name[17];
    std::snprintf(name, sizeof name, "%016" PRIx64, fsid);
    std::string path = stateDir + "/" + name;

    FileSystem& fs = FileSystem::current();
    if (int code = makeDirectories(path)) {
        return failure(
            code, "Cannot create the Tamber state directory " + path + ": " + std::strerror(code));
    }
    if (fs.faccessat(AT_FDCWD, path, W_OK | X_OK, 0) != 0) {
        int code = errno;
        return failure(code, "The Tamber state directory " + path +
                                 " is not writable: " + std::strerror(code));
    }

    std::string lockPath = path + "/" + kLockName;
    ScopedFd fd(fs.open(lockPath, O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    if (!fd.ok()) {
        int code = errno;
        return failure(code, "Cannot open the lock file " + lockPath + ": " + std::strerror(code));
    }
    using Clock = std::chrono::steady_clock;
    const auto started = Clock::now();
    const auto deadline =
        started + std::chrono::duration_cast<Clock::duration>(
                      std::chrono::duration<double>(wait.seconds > 0 ? wait.seconds : 0));
    bool announced = false;
    while (::flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
        int code = errno;
        if (code == EINTR)
            continue;
        if (code != EWOULDBLOCK) {
            return failure(code, "Cannot lock " + lockPath + ": " + std::strerror(code));
        }
        auto now = Clock::now();
        pid_t holder = holderOf(path).value_or(0);
        if (now >= deadline) {
            // An expected condition, not this process's fault: reported once, by the caller.
            return Error(kPosixErrorDomain, code, {{"description", heldMessage(path, holder)}});
        }
        // The holder writes its ID just after it takes the lock: give it a moment before
        // saying that it is unknown.
        if (!announced && (holder != 0 || now - started >= std::chrono::milliseconds(200))) {
            announced = true;
            if (wait.waiting) {
                wait.waiting(holder, path);
            } else {
                logInfo("waiting for " +
                        (holder ? "Tamber process " + std::to_string(holder)
                                : std::string("another Tamber process")) +
                        " to release the state directory " + path);
            }
        }
        std::this_thread::sleep_for(
            std::min<Clock::duration>(std::chrono::milliseconds(20), deadline - now));
    }
    // Who holds it, for the others; a longer ID left by an earlier holder ends after the line.
    std::string pid = std::to_string(::getpid()) + "\n";
    if (fs.write(fd.get(), pid.data(), pid.size()) != static_cast<ssize_t>(pid.size()))
        logError("Cannot write the lock file " + lockPath + ": " + std::strerror(errno));
    return std::unique_ptr<TremorStoreDirectory>(new TremorStoreDirectory(path, fd.release()));
}

std::optional<pid_t> TremorStoreDirectory::holderOf(const std::string& directory) {
    FileSystem& fs = FileSystem::current();
    ScopedFd fd(fs.open(directory + "/" + kLockName, O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!fd.ok())
        return std::nullopt;
    char text[32] = {};
    ssize_t n = fs.read(fd.get(), text, sizeof text - 1);
    pid_t pid = 0;
    for (ssize_t i = 0; i < n && text[i] >= '0' && text[i] <= '9' && pid < 100000000; ++i)
        pid = pid * 10 + (text[i] - '0');
    if (pid <= 0)
        return std::nullopt;
    return pid;
}

std::string TremorStoreDirectory::heldMessage(const std::string& directory, pid_t holder) {
    return "the state directory " + directory + " is held by " +
           (holder ? "Tamber process " + std::to_string(holder)
                   : std::string("another Tamber process"));
}

TremorStoreDirectory::~TremorStoreDirectory() {
    FileSystem::current().close(lockFd_);  // closing the only descriptor releases the flock
}

bool TremorStoreDirectory::databaseExists() const {
    return exists(databasePath());
}

Result<std::string> TremorStoreDirectory::moveDatabaseAside() {
    std::string from = databasePath();
    std::string to = from + ".corrupt-" + std::to_string(static_cast<int64_t>(std::time(nullptr)));
    // Two failures within a second must not overwrite the first copy.
    for (int n = 1; exists(to) || exists(to + "-wal"); ++n) {
        to = from + ".corrupt-" + std::to_string(static_cast<int64_t>(std::time(nullptr))) + "." +
             std::to_string(n);
    }
    for (const char* suffix : {"-wal", "-shm", ""}) {
        std::string source = from + suffix;
        if (!exists(source))
            continue;
        if (FileSystem::current().renameat2(AT_FDCWD, source, AT_FDCWD, to + suffix, 0) != 0) {
            int code = errno;
            return failure(code, "Cannot move " + source + " aside: " + std::strerror(code));
        }
    }
    return to;
}

void TremorStoreDirectory::removeOrphanedSidecars() {
    if (databaseExists())
        return;
    for (const char* suffix : {"-wal", "-shm"}) {
        std::string sidecar = databasePath() + suffix;
        if (exists(sidecar) && FileSystem::current().unlinkat(AT_FDCWD, sidecar, 0) != 0) {
            logError("Cannot remove " + sidecar + ": " + std::strerror(errno));
        }
    }
}

}  // namespace tamber
