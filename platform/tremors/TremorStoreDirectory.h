#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "support/Result.h"

namespace tamber {

// How long TremorStoreDirectory::acquire() waits for another holder of the lock to let go.
struct TremorLockWait {
    double seconds = 0;  // 0: fail at once
    // Called once, when the wait begins, with the holder's process ID (0 when unknown) and the
    // folder; without it, the wait is logged as an info line.
    std::function<void(pid_t holder, const std::string& directory)> waiting;
};

// The folder that holds one volume's journal, <stateDir>/<fsid as 16 hex digits>/, and the
// exclusive lock on it. Two processes writing the same SQLite files through different
// connections would not corrupt them, but they would hand out the same event IDs; the lock
// makes the second one wait its turn (or fail) instead. The holder writes its process ID into
// the lock file, so that the others can say whom they wait for.
class TremorStoreDirectory {
public:
    static constexpr const char* kDatabaseName = "journal.sqlite";
    static constexpr const char* kLockName = "lock";

    using LockWait = TremorLockWait;

    // Creates the folders as needed and takes the lock (flock, non-blocking, tried again until
    // `wait` runs out). Fails with a description naming the folder when it cannot be created or
    // written (logged), or when another process (or another store in this one) holds the lock
    // (not logged: the caller reports it, once; the description names the holder).
    static Result<std::unique_ptr<TremorStoreDirectory>> acquire(const std::string& stateDir,
                                                                 uint64_t fsid,
                                                                 const LockWait& wait = {});
    // The process ID written into the lock file of `directory` by its last holder.
    static std::optional<pid_t> holderOf(const std::string& directory);
    // "the state directory DIR is held by Tamber process PID" (or "by another Tamber process").
    static std::string heldMessage(const std::string& directory, pid_t holder);
    ~TremorStoreDirectory();  // releases the lock
    TremorStoreDirectory(const TremorStoreDirectory&) = delete;
    TremorStoreDirectory& operator=(const TremorStoreDirectory&) = delete;

    const std::string& path() const { return path_; }
    std::string databasePath() const { return path_ + "/" + kDatabaseName; }
    bool databaseExists() const;

    // Renames the database and its -wal and -shm files to journal.sqlite.corrupt-<unix time>
    // (plus the same suffixes), keeping them for inspection. Returns the new main file name.
    Result<std::string> moveDatabaseAside();
    // A -wal or -shm file without its database belongs to no database we can open; SQLite
    // must not apply it to the new one.
    void removeOrphanedSidecars();

private:
    TremorStoreDirectory(std::string path, int lockFd) : path_(std::move(path)), lockFd_(lockFd) {}

    std::string path_;
    int lockFd_;
};

}  // namespace tamber
