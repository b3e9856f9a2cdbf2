#include "platform/tremors/InodeIndex.h"

#include <cerrno>
#include <limits>
#include <unordered_map>
#include <unordered_set>

#include "platform/UrlPath.h"

namespace tamber {

namespace {

constexpr const char* kInodeIndexSchema = R"sql(
CREATE TABLE inodes(
    inode INTEGER PRIMARY KEY,
    parent INTEGER NOT NULL,
    name TEXT NOT NULL,
    kind INTEGER NOT NULL,
    birth INTEGER,
    size INTEGER,
    mtime INTEGER,
    ctime INTEGER);
CREATE INDEX inodes_by_name ON inodes(parent, name);
CREATE TABLE documents(
    doc_id INTEGER PRIMARY KEY,
    inode INTEGER NOT NULL);
CREATE UNIQUE INDEX documents_by_inode ON documents(inode);
CREATE TABLE document_attributes(
    doc_id INTEGER NOT NULL,
    name TEXT NOT NULL,
    value BLOB NOT NULL,
    PRIMARY KEY(doc_id, name)) WITHOUT ROWID;
)sql";

// Entries indexed by the first schema have no stamps: NULL columns.
constexpr const char* kUpgradeFromVersion1 = R"sql(
ALTER TABLE inodes ADD COLUMN birth INTEGER;
ALTER TABLE inodes ADD COLUMN size INTEGER;
ALTER TABLE inodes ADD COLUMN mtime INTEGER;
DROP INDEX inodes_by_parent;
CREATE INDEX inodes_by_name ON inodes(parent, name);
)sql";

// No copies yet and no change times: the next crawl reads the metadata of every document.
constexpr const char* kUpgradeFromVersion2 = R"sql(
ALTER TABLE inodes ADD COLUMN ctime INTEGER;
CREATE TABLE document_attributes(
    doc_id INTEGER NOT NULL,
    name TEXT NOT NULL,
    value BLOB NOT NULL,
    PRIMARY KEY(doc_id, name)) WITHOUT ROWID;
)sql";

constexpr const char* kFindByInode =
    "SELECT i.inode, i.parent, i.name, i.kind, d.doc_id, i.birth, i.size, i.mtime, i.ctime FROM "
    "inodes i "
    "LEFT JOIN documents d ON d.inode = i.inode WHERE i.inode = ?";
constexpr const char* kFindByParent =
    "SELECT i.inode, i.parent, i.name, i.kind, d.doc_id, i.birth, i.size, i.mtime, i.ctime FROM "
    "inodes i "
    "LEFT JOIN documents d ON d.inode = i.inode WHERE i.parent = ?";
constexpr const char* kFindByName =
    "SELECT i.inode, i.parent, i.name, i.kind, d.doc_id, i.birth, i.size, i.mtime, i.ctime FROM "
    "inodes i "
    "LEFT JOIN documents d ON d.inode = i.inode WHERE i.parent = ? AND i.name = ?";

InodeRecord readInode(const SqliteDatabase::Statement& stmt) {
    InodeRecord record;
    record.inode = fromSqlite(stmt.columnInt64(0));
    record.parent = fromSqlite(stmt.columnInt64(1));
    record.name = stmt.columnText(2);
    record.kind = static_cast<uint8_t>(stmt.columnInt64(3));
    record.docID = static_cast<uint32_t>(stmt.columnInt64(4));  // NULL reads as 0
    record.stamped = !stmt.columnIsNull(7);
    record.birth = fromSqlite(stmt.columnInt64(5));
    record.size = fromSqlite(stmt.columnInt64(6));
    record.mtime = stmt.columnInt64(7);
    record.ctime = stmt.columnInt64(8);  // NULL reads as 0
    return record;
}

}  // namespace

const char* InodeIndex::schema() {
    return kInodeIndexSchema;
}

const char* InodeIndex::upgradeFrom(int64_t version) {
    switch (version) {
        case 1:
            return kUpgradeFromVersion1;
        case 2:
            return kUpgradeFromVersion2;
        default:
            return nullptr;
    }
}

Status InodeIndex::load() {
    auto next = db_.queryInt64("SELECT next_document_id FROM meta WHERE id = 1");
    if (!next.ok())
        return next.error();
    auto highest = db_.queryInt64("SELECT coalesce(max(doc_id), 0) FROM documents");
    if (!highest.ok())
        return highest.error();
    if (next.value() < 1 || highest.value() >= next.value()) {
        return SqliteDatabase::makeError(SQLITE_CORRUPT, "checking the event journal",
                                         "document IDs beyond the counter");
    }
    nextDocumentId_ = fromSqlite(next.value());
    return Status::OK();
}

// ---- Tree ----

Status InodeIndex::upsert(const std::vector<InodeRecord>& records) {
    for (const InodeRecord& record : records) {
        if (!UrlPath::isEntryName(record.name) || record.inode == 0) {
            return Error::invalidParameter("name", record.name);
        }
    }
    if (records.empty())
        return Status::OK();
    auto txn = db_.begin();
    if (!txn.ok())
        return txn.error();
    auto upsert = db_.cached(
        "INSERT INTO inodes(inode, parent, name, kind, birth, size, mtime, ctime) "
        "VALUES(?, ?, ?, ?, ?, ?, ?, ?) "
        "ON CONFLICT(inode) DO UPDATE SET parent = excluded.parent, name = excluded.name, "
        "kind = excluded.kind, birth = excluded.birth, size = excluded.size, "
        "mtime = excluded.mtime, ctime = excluded.ctime");
    if (!upsert.ok())
        return upsert.error();
    for (const InodeRecord& record : records) {
        upsert->bind(1, toSqlite(record.inode))
            .bind(2, toSqlite(record.parent))
            .bind(3, record.name)
            .bind(4, int64_t{record.kind});
        if (record.stamped) {
            upsert->bind(5, toSqlite(record.birth))
                .bind(6, toSqlite(record.size))
                .bind(7, record.mtime);
            if (record.ctime != 0)
                upsert->bind(8, record.ctime);
        }  // else left NULL
        if (Status status = upsert->run(); !status.ok())
            return status;
    }
    return txn->commit();
}

Status InodeIndex::remove(const std::vector<uint64_t>& inodes) {
    if (inodes.empty())
        return Status::OK();
    auto txn = db_.begin();
    if (!txn.ok())
        return txn.error();
    auto erase = db_.cached("DELETE FROM inodes WHERE inode = ?");
    if (!erase.ok())
        return erase.error();
    for (uint64_t inode : inodes) {
        if (Status status = erase->bind(1, toSqlite(inode)).run(); !status.ok())
            return status;
    }
    return txn->commit();
}

template <class T, class Read>
Result<std::optional<T>> InodeIndex::findOne(std::string_view sql, int64_t key, Read read) {
    auto stmt = db_.cached(sql);
    if (!stmt.ok())
        return stmt.error();
    auto row = stmt->bind(1, key).step();
    if (!row.ok())
        return row.error();
    if (!row.value())
        return std::optional<T>();
    return std::optional<T>(read(stmt.value()));
}

Result<std::optional<InodeRecord>> InodeIndex::find(uint64_t inode) {
    return findOne<InodeRecord>(kFindByInode, toSqlite(inode), readInode);
}

Result<std::optional<std::string>> InodeIndex::path(
    uint64_t inode, const std::function<const std::string*(uint64_t)>& rootPath) {
    auto stmt = db_.cached("SELECT parent, name FROM inodes WHERE inode = ?");
    if (!stmt.ok())
        return stmt.error();
    std::vector<std::string> names;
    std::unordered_set<uint64_t> seen;
    // The index may be damaged: a cycle or an endless chain ends the walk, never the process.
    for (uint64_t current = inode; current != 0;) {
        if (const std::string* top = rootPath(current)) {
            std::string path = *top;
            for (auto name = names.rbegin(); name != names.rend(); ++name) {
                if (path.back() != '/')
                    path += '/';
                path += *name;
            }
            return std::optional<std::string>(std::move(path));
        }
        if (names.size() == kMaxPathComponents || !seen.insert(current).second)
            break;
        auto row = stmt->bind(1, toSqlite(current)).step();
        if (!row.ok())
            return row.error();
        if (!row.value())
            break;
        std::string name = stmt->columnText(1);
        if (!UrlPath::isEntryName(name))
            break;  // never let the index name a path outside its root
        names.push_back(std::move(name));
        current = fromSqlite(stmt->columnInt64(0));
        stmt->reset();
    }
    return std::optional<std::string>();
}

Result<std::vector<InodeIndex::Placement>> InodeIndex::place(
    const std::vector<uint64_t>& inodes,
    const std::function<const std::string*(uint64_t)>& rootPath) {
    std::vector<Placement> placed(inodes.size());
    // The entries of one listing share their folder: its path is walked once.
    std::unordered_map<uint64_t, std::optional<std::string>> folders;
    for (size_t i = 0; i < inodes.size(); ++i) {
        auto entry = find(inodes[i]);
        if (!entry.ok())
            return entry.error();
        if (const std::string* top = rootPath(inodes[i])) {
            placed[i].path = *top;
        } else if (entry.value() && UrlPath::isEntryName(entry.value()->name)) {
            auto folder = folders.find(entry.value()->parent);
            if (folder == folders.end()) {
                auto walked = path(entry.value()->parent, rootPath);
                if (!walked.ok())
                    return walked.error();
                folder = folders.emplace(entry.value()->parent, std::move(walked).value()).first;
            }
            if (folder->second) {
                std::string found = *folder->second;
                if (found.back() != '/')
                    found += '/';
                placed[i].path = found + entry.value()->name;
            }
        }
        if (entry.value()) {
            placed[i].docID = entry.value()->docID;
        } else {
            auto docID = documentIdForInode(inodes[i]);
            if (!docID.ok())
                return docID.error();
            placed[i].docID = docID.value().value_or(0);
        }
    }
    return placed;
}

Result<std::vector<InodeRecord>> InodeIndex::children(uint64_t parent) {
    auto stmt = db_.cached(kFindByParent);
    if (!stmt.ok())
        return stmt.error();
    return readAll(stmt->bind(1, toSqlite(parent)));
}

Result<std::vector<InodeRecord>> InodeIndex::childrenNamed(uint64_t parent, std::string_view name) {
    auto stmt = db_.cached(kFindByName);
    if (!stmt.ok())
        return stmt.error();
    return readAll(stmt->bind(1, toSqlite(parent)).bind(2, name));
}

Result<std::vector<InodeRecord>> InodeIndex::readAll(SqliteDatabase::Statement& stmt) {
    std::vector<InodeRecord> result;
    Result<bool> r = stmt.step();
    for (; r.ok() && r.value(); r = stmt.step()) result.push_back(readInode(stmt));
    if (!r.ok())
        return r.error();
    return result;
}

// ---- Document IDs ----

Result<std::optional<uint32_t>> InodeIndex::documentIdForInode(uint64_t inode) {
    return findOne<uint32_t>(
        "SELECT doc_id FROM documents WHERE inode = ?", toSqlite(inode),
        [](SqliteDatabase::Statement& stmt) { return static_cast<uint32_t>(stmt.columnInt64(0)); });
}

Result<std::optional<uint64_t>> InodeIndex::inodeForDocumentId(uint32_t docID) {
    return findOne<uint64_t>(
        "SELECT inode FROM documents WHERE doc_id = ?", int64_t{docID},
        [](SqliteDatabase::Statement& stmt) { return fromSqlite(stmt.columnInt64(0)); });
}

Result<uint32_t> InodeIndex::allocateDocumentId(uint64_t inode) {
    auto ids = allocateDocumentIds({NewDocument{inode, {}}});
    if (!ids.ok())
        return ids.error();
    return ids.value().front();
}

Result<std::vector<uint32_t>> InodeIndex::allocateDocumentIds(
    const std::vector<NewDocument>& documents) {
    std::vector<uint32_t> ids(documents.size(), 0);
    std::vector<size_t> fresh;                        // positions that get a new ID
    std::unordered_map<uint64_t, size_t> firstFresh;  // an inode asked for twice gets one ID
    for (size_t i = 0; i < documents.size(); ++i) {
        uint64_t inode = documents[i].inode;
        if (inode == 0)
            return Error::invalidParameter("inode", "0");
        auto existing = documentIdForInode(inode);
        if (!existing.ok())
            return existing.error();
        if (existing.value())
            ids[i] = *existing.value();
        else if (firstFresh.try_emplace(inode, i).second)
            fresh.push_back(i);
    }
    if (!fresh.empty()) {
        if (nextDocumentId_ + fresh.size() - 1 > std::numeric_limits<uint32_t>::max()) {
            return Error(kPosixErrorDomain, EOVERFLOW,
                         {{"description", "Every document ID of this volume has been used"}});
        }
        // The counter moves in the same transaction as the rows, so a crash cannot reuse an ID;
        // and the rows are written before any ID is handed out, so none is lost in one.
        auto txn = db_.begin();
        if (!txn.ok())
            return txn.error();
        auto insert = db_.cached("INSERT INTO documents(doc_id, inode) VALUES(?, ?)");
        if (!insert.ok())
            return insert.error();
        uint64_t next = nextDocumentId_;
        for (size_t i : fresh) {
            if (Status status =
                    insert->bind(1, toSqlite(next)).bind(2, toSqlite(documents[i].inode)).run();
                !status.ok())
                return status.error();
            for (const auto& [name, value] : documents[i].attributes) {
                if (Status status = setDocumentAttribute(static_cast<uint32_t>(next), name, value);
                    !status.ok())
                    return status.error();
            }
            ids[i] = static_cast<uint32_t>(next++);
        }
        auto meta = db_.cached("UPDATE meta SET next_document_id = ? WHERE id = 1");
        if (!meta.ok())
            return meta.error();
        if (Status status = meta->bind(1, toSqlite(next)).run(); !status.ok())
            return status.error();
        if (Status status = txn->commit(); !status.ok())
            return status.error();
        nextDocumentId_ = next;
    }
    for (size_t i = 0; i < documents.size(); ++i) {
        if (ids[i] == 0)
            ids[i] = ids[firstFresh.at(documents[i].inode)];
    }
    return ids;
}

Status InodeIndex::moveDocumentId(uint32_t docID, uint64_t newInode) {
    if (newInode == 0)
        return Error::invalidParameter("inode", "0");
    if (docID == 0 || docID >= nextDocumentId_) {
        return Error(kPosixErrorDomain, ENOENT,
                     {{"description", "No document has the ID " + std::to_string(docID)}});
    }
    auto holder = documentIdForInode(newInode);
    if (!holder.ok())
        return holder.error();
    if (holder.value() == docID)
        return Status::OK();
    if (holder.value()) {
        return Error(
            kPosixErrorDomain, EEXIST,
            {{"description", "Inode " + std::to_string(newInode) + " already has the document ID " +
                                 std::to_string(*holder.value())}});
    }
    // Also takes back an ID that was detached from its inode (handed out once, so below the
    // counter).
    auto update = db_.cached(
        "INSERT INTO documents(doc_id, inode) VALUES(?, ?) "
        "ON CONFLICT(doc_id) DO UPDATE SET inode = excluded.inode");
    if (!update.ok())
        return update.error();
    return update->bind(1, int64_t{docID}).bind(2, toSqlite(newInode)).run();
}

Status InodeIndex::detachDocumentId(uint32_t docID) {
    auto erase = db_.cached("DELETE FROM documents WHERE doc_id = ?");
    if (!erase.ok())
        return erase.error();
    return erase->bind(1, int64_t{docID}).run();
}

Status InodeIndex::clearDocumentId(uint32_t docID) {
    if (Status status = detachDocumentId(docID); !status.ok())
        return status;
    auto erase = db_.cached("DELETE FROM document_attributes WHERE doc_id = ?");
    if (!erase.ok())
        return erase.error();
    return erase->bind(1, int64_t{docID}).run();
}

// ---- Copies of the documents' metadata attributes ----

Result<InodeIndex::Attributes> InodeIndex::documentAttributes(uint32_t docID) {
    auto stmt = db_.cached("SELECT name, value FROM document_attributes WHERE doc_id = ?");
    if (!stmt.ok())
        return stmt.error();
    stmt->bind(1, int64_t{docID});
    Attributes attributes;
    Result<bool> r = stmt->step();
    for (; r.ok() && r.value(); r = stmt->step())
        attributes.emplace(stmt->columnText(0), stmt->columnBlob(1));
    if (!r.ok())
        return r.error();
    return attributes;
}

Status InodeIndex::setDocumentAttribute(uint32_t docID, const std::string& name,
                                        const std::optional<Bytes>& value) {
    if (!value) {
        auto erase = db_.cached("DELETE FROM document_attributes WHERE doc_id = ? AND name = ?");
        if (!erase.ok())
            return erase.error();
        return erase->bind(1, int64_t{docID}).bind(2, name).run();
    }
    auto upsert = db_.cached(
        "INSERT INTO document_attributes(doc_id, name, value) VALUES(?, ?, ?) "
        "ON CONFLICT(doc_id, name) DO UPDATE SET value = excluded.value");
    if (!upsert.ok())
        return upsert.error();
    return upsert->bind(1, int64_t{docID}).bind(2, name).bindBlob(3, *value).run();
}

Status InodeIndex::replaceDocumentAttributes(uint32_t docID, const Attributes& attributes) {
    auto txn = db_.begin();
    if (!txn.ok())
        return txn.error();
    auto erase = db_.cached("DELETE FROM document_attributes WHERE doc_id = ?");
    if (!erase.ok())
        return erase.error();
    if (Status status = erase->bind(1, int64_t{docID}).run(); !status.ok())
        return status;
    for (const auto& [name, value] : attributes) {
        if (Status status = setDocumentAttribute(docID, name, value); !status.ok())
            return status;
    }
    return txn->commit();
}

Result<std::vector<InodeRecord>> InodeIndex::subtree(uint64_t top,
                                                     std::unordered_set<uint64_t> stops) {
    std::vector<InodeRecord> found;
    std::vector<uint64_t> stack{top};
    stops.insert(top);
    while (!stack.empty()) {
        uint64_t dir = stack.back();
        stack.pop_back();
        auto entries = children(dir);
        if (!entries.ok())
            return entries.error();
        for (InodeRecord& child : entries.value()) {
            if (!stops.insert(child.inode).second)
                continue;  // a stop, or a cycle left by lost events
            if (child.kind == InodeRecord::kDirectory)
                stack.push_back(child.inode);
            found.push_back(std::move(child));
        }
    }
    return found;
}

}  // namespace tamber
