#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "support/Result.h"

namespace tamber {

// The folder that holds one volume's journal, <stateDir>/<fsid as 16 hex digits>/, and the
// exclusive lock on it. Two processes writing the same SQLite files through different
// connections would not corrupt them, but they would hand out the same event IDs; the lock
// makes the second one fail instead.
class TremorStoreDirectory {
public:
    static constexpr const char* kDatabaseName = "journal.sqlite";

    // Creates the folders as needed and takes the lock (flock, non-blocking). Fails with a
    // description naming the folder when it cannot be created or written, or when another
    // process (or another store in this one) holds the lock.
    static Result<std::unique_ptr<TremorStoreDirectory>> acquire(const std::string& stateDir,
                                                                 uint64_t fsid);
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
