#include "platform/tremors/TremorStoreDirectory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "platform/FileSystem.h"
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
    const std::string& stateDir, uint64_t fsid) {
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

    std::string lockPath = path + "/lock";
    int fd = fs.open(lockPath, O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0) {
        int code = errno;
        return failure(code, "Cannot open the lock file " + lockPath + ": " + std::strerror(code));
    }
    if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
        int code = errno;
        fs.close(fd);
        if (code == EWOULDBLOCK) {
            return failure(code, "Another Tamber process is using the state directory " + path);
        }
        return failure(code, "Cannot lock " + lockPath + ": " + std::strerror(code));
    }
    return std::unique_ptr<TremorStoreDirectory>(new TremorStoreDirectory(path, fd));
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
