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
#include <filesystem>

#include "support/Log.h"

namespace tamber {

namespace {

Error failure(int code, std::string description) {
    logError(description);
    return Error(kPosixErrorDomain, code, {{"description", std::move(description)}});
}

bool exists(const std::string& path) {
    struct stat st;
    return ::lstat(path.c_str(), &st) == 0;
}

}  // namespace

Result<std::unique_ptr<TremorStoreDirectory>> TremorStoreDirectory::acquire(
    const std::string& stateDir, uint64_t fsid) {
    char name[17];
    std::snprintf(name, sizeof name, "%016" PRIx64, fsid);
    std::string path = stateDir + "/" + name;

    std::error_code ec;
    std::filesystem::create_directories(path, ec);
    if (ec) {
        return failure(ec.value(),
                       "Cannot create the Tamber state directory " + path + ": " + ec.message());
    }
    if (::access(path.c_str(), W_OK | X_OK) != 0) {
        int code = errno;
        return failure(code, "The Tamber state directory " + path +
                                 " is not writable: " + std::strerror(code));
    }

    std::string lockPath = path + "/lock";
    int fd = ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0) {
        int code = errno;
        return failure(code, "Cannot open the lock file " + lockPath + ": " + std::strerror(code));
    }
    if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
        int code = errno;
        ::close(fd);
        if (code == EWOULDBLOCK) {
            return failure(code, "Another Tamber process is using the state directory " + path);
        }
        return failure(code, "Cannot lock " + lockPath + ": " + std::strerror(code));
    }
    return std::unique_ptr<TremorStoreDirectory>(new TremorStoreDirectory(path, fd));
}

TremorStoreDirectory::~TremorStoreDirectory() {
    ::close(lockFd_);  // closing the only descriptor releases the flock
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
        if (::rename(source.c_str(), (to + suffix).c_str()) != 0) {
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
        if (exists(sidecar) && ::unlink(sidecar.c_str()) != 0) {
            logError("Cannot remove " + sidecar + ": " + std::strerror(errno));
        }
    }
}

}  // namespace tamber
