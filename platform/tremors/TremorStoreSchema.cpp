#include "platform/tremors/TremorStoreSchema.h"

#include <sys/random.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>

#include "platform/tremors/InodeIndex.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr const char* kSchema = R"sql(
CREATE TABLE meta(
    id INTEGER PRIMARY KEY CHECK (id = 1),
    uuid TEXT NOT NULL,
    next_event_id INTEGER NOT NULL,
    oldest_event_id INTEGER NOT NULL,
    next_document_id INTEGER NOT NULL);
CREATE TABLE events(
    id INTEGER PRIMARY KEY,
    root INTEGER NOT NULL,
    path TEXT NOT NULL,
    file_id INTEGER NOT NULL,
    flags INTEGER NOT NULL);
CREATE INDEX events_by_root ON events(root, id);
)sql";

Result<std::string> randomUuid() {
    unsigned char bytes[16];
    size_t got = 0;
    while (got < sizeof bytes) {
        ssize_t n = ::getrandom(bytes + got, sizeof bytes - got, 0);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return Error::errorWithPOSIXCode(errno);
        }
        got += static_cast<size_t>(n);
    }
    bytes[6] = static_cast<unsigned char>((bytes[6] & 0x0f) | 0x40);  // version 4
    bytes[8] = static_cast<unsigned char>((bytes[8] & 0x3f) | 0x80);  // RFC 4122 variant
    char text[37];
    std::snprintf(text, sizeof text,
                  "%02X%02X%02X%02X-%02X%02X-%02X%02X-%02X%02X-%02X%02X%02X%02X%02X%02X", bytes[0],
                  bytes[1], bytes[2], bytes[3], bytes[4], bytes[5], bytes[6], bytes[7], bytes[8],
                  bytes[9], bytes[10], bytes[11], bytes[12], bytes[13], bytes[14], bytes[15]);
    return std::string(text);
}

}  // namespace

Error TremorStoreSchema::corrupt(const std::string& what) {
    return SqliteDatabase::makeError(SQLITE_CORRUPT, "checking the event journal", what);
}

Status TremorStoreSchema::prepare(SqliteDatabase& db, const std::string& directory) {
    if (Status status = configure(db); !status.ok())
        return status;

    auto version = db.queryInt64("PRAGMA user_version");
    if (!version.ok())
        return version.error();
    if (version.value() == 0) {
        auto objects = db.queryInt64("SELECT count(*) FROM sqlite_schema");
        if (!objects.ok())
            return objects.error();
        if (objects.value() != 0)
            return corrupt("tables without a schema version");
        if (Status status = create(db, directory); !status.ok())
            return status;
    } else if (version.value() < 1 || version.value() > kVersion) {
        return corrupt("schema version " + std::to_string(version.value()) + ", expected " +
                       std::to_string(kVersion));
    } else {
        auto check = db.queryText("PRAGMA quick_check(1)");
        if (!check.ok())
            return check.error();
        if (check.value() != "ok") {
            std::string found = check.value();
            std::replace(found.begin(), found.end(), '\n', ' ');  // one log line
            return corrupt("quick check: " + found);
        }
        if (version.value() < kVersion) {
            if (Status status = upgrade(db, directory, version.value()); !status.ok())
                return status;
        }
    }
    return Status::OK();
}

Status TremorStoreSchema::configure(SqliteDatabase& db) {
    // The directory lock already keeps every other Tamber process out, so the connection may
    // keep its file locks for good: that saves two fcntl calls per statement, and with WAL
    // entered in this mode the WAL index lives in memory rather than in a -shm file.
    if (Status status = db.exec("PRAGMA busy_timeout = 5000; PRAGMA locking_mode = EXCLUSIVE");
        !status.ok())
        return status;
    auto mode = db.queryText("PRAGMA journal_mode = WAL");
    if (!mode.ok())
        return mode.error();
    if (mode.value() != "wal") {
        return SqliteDatabase::makeError(SQLITE_ERROR, "switching to WAL", "mode " + mode.value());
    }
    // Losing the last transactions in a power cut is acceptable (anchors into them expire);
    // the larger cache keeps random inode-index writes off the disk.
    return db.exec("PRAGMA synchronous = NORMAL; PRAGMA cache_size = -32768");
}

Status TremorStoreSchema::create(SqliteDatabase& db, const std::string& directory) {
    auto uuid = randomUuid();
    if (!uuid.ok())
        return uuid.error();
    auto txn = db.begin();
    if (!txn.ok())
        return txn.error();
    if (Status status =
            db.exec(std::string(kSchema) + WatchedRoots::schema() + InodeIndex::schema());
        !status.ok())
        return status;
    auto insert = db.prepare(
        "INSERT INTO meta(id, uuid, next_event_id, oldest_event_id, next_document_id) "
        "VALUES(1, ?, 1, 1, 1)");
    if (!insert.ok())
        return insert.error();
    if (Status status = insert->bind(1, uuid.value()).run(); !status.ok())
        return status;
    if (Status status = db.exec("PRAGMA user_version = " + std::to_string(kVersion)); !status.ok())
        return status;
    if (Status status = txn->commit(); !status.ok())
        return status;
    logInfo("Started a new event journal " + uuid.value() + " in " + directory);
    return Status::OK();
}

Status TremorStoreSchema::upgrade(SqliteDatabase& db, const std::string& directory, int64_t from) {
    // Only the index changed: the journal, the roots and the document IDs stay as they are.
    auto txn = db.begin();
    if (!txn.ok())
        return txn.error();
    for (int64_t version = from; version < kVersion; ++version) {
        if (const char* sql = InodeIndex::upgradeFrom(version)) {
            if (Status status = db.exec(sql); !status.ok())
                return status;
        }
    }
    if (Status status = db.exec("PRAGMA user_version = " + std::to_string(kVersion)); !status.ok())
        return status;
    if (Status status = txn->commit(); !status.ok())
        return status;
    logInfo("Upgraded the event journal in " + directory + " from schema " + std::to_string(from) +
            " to " + std::to_string(kVersion));
    return Status::OK();
}

}  // namespace tamber
