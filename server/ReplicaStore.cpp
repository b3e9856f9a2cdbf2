#include "server/ReplicaStore.h"

#include <fcntl.h>

#include <cerrno>

#include "items/LocalItem.h"
#include "platform/FileSystem.h"
#include "runtime/HostJson.h"
#include "server/ReplicaSearch.h"
#include "support/Log.h"

namespace tamber {

namespace {

// The items, the trigram index kept in step with them by triggers (an external-content index
// stores no second copy of the names), the anchor and counters, and the batch history.
constexpr const char* kSchema = R"sql(
CREATE TABLE meta(key TEXT PRIMARY KEY, value) WITHOUT ROWID;
CREATE TABLE items(
  row INTEGER PRIMARY KEY,
  id TEXT NOT NULL UNIQUE,
  parent TEXT NOT NULL,
  filename TEXT NOT NULL,
  type TEXT NOT NULL,
  size INTEGER,
  created REAL,
  modified REAL,
  tags TEXT NOT NULL,
  favorite REAL,
  lastUsed REAL,
  trashed INTEGER NOT NULL,
  path BLOB,
  json TEXT NOT NULL);
CREATE INDEX items_parent ON items(parent);
CREATE INDEX items_path ON items(path);
CREATE INDEX items_filename ON items(filename, id);
CREATE INDEX items_type ON items(type);
CREATE INDEX items_last_used ON items(lastUsed) WHERE lastUsed IS NOT NULL;
CREATE VIRTUAL TABLE names USING fts5(filename, content='items', content_rowid='row',
                                      tokenize='trigram');
CREATE TRIGGER items_inserted AFTER INSERT ON items BEGIN
  INSERT INTO names(rowid, filename) VALUES (new.row, new.filename);
END;
CREATE TRIGGER items_deleted AFTER DELETE ON items BEGIN
  INSERT INTO names(names, rowid, filename) VALUES ('delete', old.row, old.filename);
END;
CREATE TRIGGER items_updated AFTER UPDATE OF filename ON items BEGIN
  INSERT INTO names(names, rowid, filename) VALUES ('delete', old.row, old.filename);
  INSERT INTO names(rowid, filename) VALUES (new.row, new.filename);
END;
CREATE TABLE batches(seq INTEGER PRIMARY KEY, json TEXT NOT NULL);
)sql";

std::string quoted(const std::string& path) {
    return "\"" + path + "\"";
}

// The folder of `path`, made (with its parents) when missing.
Status makeFolderOf(const std::string& path) {
    auto slash = path.find_last_of('/');
    if (slash == std::string::npos || slash == 0)
        return Status::OK();
    std::string folder = path.substr(0, slash);
    for (size_t next = 1; next != std::string::npos;) {
        next = folder.find('/', next + 1);
        std::string part = folder.substr(0, next);
        if (FileSystem::current().mkdir(part, 0700) != 0 && errno != EEXIST)
            return Error::errorWithPOSIXCode(errno);
    }
    return Status::OK();
}

// The database and the files SQLite keeps beside it.
void removeDatabaseFiles(const std::string& path) {
    for (const char* suffix : {"", "-wal", "-shm", "-journal"})
        FileSystem::current().unlinkat(AT_FDCWD, path + suffix, 0);
}

std::optional<double> dateValue(const std::shared_ptr<const Date>& date) {
    if (!date)
        return std::nullopt;
    return date->timeIntervalSince1970();
}

void bindOptional(SqliteDatabase::Statement& stmt, int index, std::optional<double> value) {
    if (value) {
        stmt.bind(index, *value);
    } else {
        stmt.bindNull(index);
    }
}

}  // namespace

ReplicaStore::ReplicaStore(std::unique_ptr<SqliteDatabase> db) : db_(std::move(db)) {}

Result<std::unique_ptr<SqliteDatabase>> ReplicaStore::openChecked(const std::string& path) {
    auto opened = SqliteDatabase::open(path);
    if (!opened.ok())
        return opened.error();
    SqliteDatabase& db = *opened.value();
    // The first read of the file: a file that is not a database fails here.
    auto version = db.queryInt64("PRAGMA user_version");
    if (!version.ok())
        return version.error();
    if (version.value() == 0) {
        auto tables = db.queryInt64("SELECT count(*) FROM sqlite_master");
        if (!tables.ok())
            return tables.error();
        if (tables.value() != 0) {
            return SqliteDatabase::makeError(SQLITE_CORRUPT, "opening " + path,
                                             "tables without a schema version");
        }
        if (Status s = createSchema(db); !s.ok())
            return s.error();
    } else if (version.value() != kSchemaVersion) {
        return SqliteDatabase::makeError(
            SQLITE_CORRUPT, "opening " + path,
            "unknown schema version " + std::to_string(version.value()));
    }
    if (Status s = db.exec("PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL;"); !s.ok())
        return s.error();
    return std::move(opened).value();
}

Status ReplicaStore::createSchema(SqliteDatabase& db) {
    auto transaction = db.begin();
    if (!transaction.ok())
        return transaction.error();
    if (Status s = db.exec(kSchema); !s.ok())
        return s;
    if (Status s = db.exec("PRAGMA user_version=" + std::to_string(kSchemaVersion)); !s.ok())
        return s;
    return transaction->commit();
}

Result<std::unique_ptr<ReplicaStore>> ReplicaStore::open(const std::string& path) {
    if (Status s = makeFolderOf(path); !s.ok())
        return s.error();
    auto db = openChecked(path);
    if (!db.ok()) {
        // What the replica holds can always be listed again: a file it cannot use is replaced.
        logError("replica database " + quoted(path) + " is unusable (" + db.error().description() +
                 "); rebuilding it from a full listing");
        removeDatabaseFiles(path);
        db = openChecked(path);
        if (!db.ok())
            return db.error();
    }
    std::unique_ptr<ReplicaStore> store(new ReplicaStore(std::move(db).value()));
    if (Status s = store->loadCounters(); !s.ok())
        return s.error();
    return store;
}

Status ReplicaStore::loadCounters() {
    auto stmt = db_->prepare("SELECT key, value FROM meta WHERE key IN ('sequence', 'floor')");
    if (!stmt.ok())
        return stmt.error();
    return stmt->eachRow([&] {
        uint64_t value = fromSqlite(stmt->columnInt64(1));
        if (stmt->columnText(0) == "sequence")
            sequence_ = value;
        else
            floor_ = value;
        return Status::OK();
    });
}

Result<std::optional<HostPorterSyncAnchor>> ReplicaStore::anchor() {
    auto stmt = db_->cached("SELECT value FROM meta WHERE key = 'anchor'");
    if (!stmt.ok())
        return stmt.error();
    auto row = stmt->step();
    if (!row.ok())
        return row.error();
    if (!row.value())
        return std::optional<HostPorterSyncAnchor>();
    return std::optional<HostPorterSyncAnchor>(stmt->columnBlob(0));
}

Result<uint64_t> ReplicaStore::itemCount() {
    auto count = db_->queryInt64("SELECT count(*) FROM items");
    if (!count.ok())
        return count.error();
    return fromSqlite(count.value());
}

Result<bool> ReplicaStore::holds(const HostPorterItemIdentifier& identifier) {
    auto stmt = db_->cached("SELECT 1 FROM items WHERE id = ?");
    if (!stmt.ok())
        return stmt.error();
    return stmt->bind(1, identifier).step();
}

Status ReplicaStore::setMeta(const char* key, int64_t value) {
    auto stmt = db_->cached("INSERT OR REPLACE INTO meta(key, value) VALUES (?, ?)");
    if (!stmt.ok())
        return stmt.error();
    return stmt->bind(1, std::string_view(key)).bind(2, value).run();
}

Status ReplicaStore::setAnchor(const HostPorterSyncAnchor& anchor) {
    auto stmt = db_->cached("INSERT OR REPLACE INTO meta(key, value) VALUES ('anchor', ?)");
    if (!stmt.ok())
        return stmt.error();
    return stmt->bindBlob(1, anchor).run();
}

Status ReplicaStore::upsert(const HostPorterItem& item, const nlohmann::json& json) {
    auto stmt = db_->cached(
        "INSERT INTO items(id, parent, filename, type, size, created, modified, tags, favorite, "
        "lastUsed, trashed, path, json) VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?) "
        "ON CONFLICT(id) DO UPDATE SET parent = excluded.parent, filename = excluded.filename, "
        "type = excluded.type, size = excluded.size, created = excluded.created, "
        "modified = excluded.modified, tags = excluded.tags, favorite = excluded.favorite, "
        "lastUsed = excluded.lastUsed, trashed = excluded.trashed, path = excluded.path, "
        "json = excluded.json");
    if (!stmt.ok())
        return stmt.error();
    stmt->bind(1, item.itemIdentifier()).bind(2, item.parentItemIdentifier());
    // The shown name (valid UTF-8) is what people search for.
    stmt->bind(3, json.value("filename", std::string())).bind(4, item.typeIdentifier());
    if (auto size = item.documentSize())
        stmt->bind(5, size->int64Value());
    else
        stmt->bindNull(5);
    bindOptional(*stmt, 6, dateValue(item.creationDate()));
    bindOptional(*stmt, 7, dateValue(item.contentModificationDate()));
    stmt->bind(8, json.value("tags", nlohmann::json::array()).dump());
    if (auto rank = item.favoriteRank())
        bindOptional(*stmt, 9, rank->doubleValue());
    else
        stmt->bindNull(9);
    bindOptional(*stmt, 10, dateValue(item.lastUsedDate()));
    stmt->bind(11, int64_t{item.isTrashed() ? 1 : 0});
    if (const auto* local = dynamic_cast<const LocalItem*>(&item)) {
        const std::string& path = local->fileURL().path();
        stmt->bindBlob(12, {reinterpret_cast<const uint8_t*>(path.data()), path.size()});
    } else {
        stmt->bindNull(12);
    }
    stmt->bind(13, json.dump());
    return stmt->run();
}

Status ReplicaStore::remove(const HostPorterItemIdentifier& identifier) {
    // A folder's content goes with it, as in a file browser.
    auto stmt = db_->cached(
        "WITH RECURSIVE gone(id) AS (VALUES (?) UNION SELECT items.id FROM items JOIN gone "
        "ON items.parent = gone.id) DELETE FROM items WHERE id IN gone");
    if (!stmt.ok())
        return stmt.error();
    return stmt->bind(1, identifier).run();
}

Result<uint64_t> ReplicaStore::replaceAll(const std::vector<HostPorterItemRef>& items,
                                          const HostPorterSyncAnchor& anchor) {
    auto transaction = db_->begin();
    if (!transaction.ok())
        return transaction.error();
    if (Status s = db_->exec("DELETE FROM items; DELETE FROM batches;"); !s.ok())
        return s.error();
    for (const auto& item : items) {
        if (!item)
            continue;
        if (Status s = upsert(*item, HostJson::item(*item)); !s.ok())
            return s.error();
    }
    const uint64_t sequence = sequence_ + 1;
    if (Status s = setAnchor(anchor); !s.ok())
        return s.error();
    if (Status s = setMeta("sequence", toSqlite(sequence)); !s.ok())
        return s.error();
    if (Status s = setMeta("floor", toSqlite(sequence)); !s.ok())
        return s.error();
    if (Status s = transaction->commit(); !s.ok())
        return s.error();
    sequence_ = floor_ = sequence;
    return sequence;
}

Result<std::optional<ReplicaBatch>> ReplicaStore::applyBatch(const ChangeCollector::Batch& batch,
                                                             size_t historyBatches) {
    if (!batch.anchor)
        return Error::invalidParameter("anchor");
    auto transaction = db_->begin();
    if (!transaction.ok())
        return transaction.error();
    nlohmann::json changes;
    if (!batch.changes.empty()) {
        changes = HostJson::changeBatch(batch);
        changes.erase("anchor");
        changes.erase("moreComing");
        const nlohmann::json& updated = changes["updated"];
        size_t next = 0;
        // In the order the provider sent them: a deletion then an update of the same
        // identifier leaves the item, the other order removes it.
        for (const auto& change : batch.changes) {
            Status s =
                change.item ? upsert(*change.item, updated.at(next++)) : remove(change.deletedItem);
            if (!s.ok())
                return s.error();
        }
    }
    if (Status s = setAnchor(*batch.anchor); !s.ok())
        return s.error();
    std::optional<ReplicaBatch> applied;
    uint64_t floor = floor_;
    if (!changes.is_null()) {
        applied = ReplicaBatch{sequence_ + 1, std::move(changes)};
        auto insert = db_->cached("INSERT INTO batches(seq, json) VALUES (?, ?)");
        if (!insert.ok())
            return insert.error();
        if (Status s =
                insert->bind(1, toSqlite(applied->sequence)).bind(2, applied->changes.dump()).run();
            !s.ok())
            return s.error();
        if (applied->sequence > floor + historyBatches)
            floor = applied->sequence - historyBatches;
        auto prune = db_->cached("DELETE FROM batches WHERE seq <= ?");
        if (!prune.ok())
            return prune.error();
        if (Status s = prune->bind(1, toSqlite(floor)).run(); !s.ok())
            return s.error();
        if (Status s = setMeta("sequence", toSqlite(applied->sequence)); !s.ok())
            return s.error();
        if (Status s = setMeta("floor", toSqlite(floor)); !s.ok())
            return s.error();
    }
    if (Status s = transaction->commit(); !s.ok())
        return s.error();
    if (applied) {
        sequence_ = applied->sequence;
        floor_ = floor;
    }
    return applied;
}

Result<uint64_t> ReplicaStore::deleteDomains(const std::vector<std::string>& domainIdentifiers) {
    auto transaction = db_->begin();
    if (!transaction.ok())
        return transaction.error();
    auto before = itemCount();
    if (!before.ok())
        return before.error();
    for (const auto& domain : domainIdentifiers) {
        // Everything under the library's folder (its trash too, whose items are not linked to
        // it by parent), then the library and whatever still hangs from it.
        auto path = db_->cached("SELECT path FROM items WHERE id = ? AND path IS NOT NULL");
        if (!path.ok())
            return path.error();
        path->bind(1, domain);
        auto row = path->step();
        if (!row.ok())
            return row.error();
        if (row.value()) {
            std::vector<uint8_t> low = path->columnBlob(0);
            std::vector<uint8_t> high = low;
            low.push_back('/');
            high.push_back('/' + 1);
            path->reset();
            auto under = db_->cached("DELETE FROM items WHERE path >= ? AND path < ?");
            if (!under.ok())
                return under.error();
            if (Status s = under->bindBlob(1, low).bindBlob(2, high).run(); !s.ok())
                return s.error();
        } else {
            path->reset();
        }
        if (Status s = remove(domain); !s.ok())
            return s.error();
    }
    auto after = itemCount();
    if (!after.ok())
        return after.error();
    if (Status s = transaction->commit(); !s.ok())
        return s.error();
    return before.value() - after.value();
}

Result<std::vector<ReplicaBatch>> ReplicaStore::batchesSince(uint64_t sequence) {
    if (sequence < floor_ || sequence > sequence_)
        return Error::syncAnchorExpired();
    auto stmt = db_->cached("SELECT seq, json FROM batches WHERE seq > ? ORDER BY seq");
    if (!stmt.ok())
        return stmt.error();
    stmt->bind(1, toSqlite(sequence));
    std::vector<ReplicaBatch> batches;
    Status read = stmt->eachRow([&]() -> Status {
        auto json = nlohmann::json::parse(stmt->columnText(1), nullptr, false);
        if (json.is_discarded())
            return SqliteDatabase::makeError(SQLITE_CORRUPT, "reading the batch history",
                                             "a batch that is not JSON");
        batches.push_back({fromSqlite(stmt->columnInt64(0)), std::move(json)});
        return Status::OK();
    });
    if (!read.ok())
        return read.error();
    return batches;
}

Result<std::vector<nlohmann::json>> ReplicaStore::search(const ReplicaSearchQuery& query) {
    return ReplicaSearch(*db_).run(query);
}

}  // namespace tamber
