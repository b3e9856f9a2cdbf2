#include "platform/tremors/TremorStore.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>

#include "platform/tremors/TremorStoreSchema.h"
#include "support/Log.h"

namespace tamber {

namespace {

Error corrupt(const std::string& what) {
    return TremorStoreSchema::corrupt(what);
}

// Errors that say nothing about the file itself: moving it aside would lose a good journal.
bool isTransient(const Error& error) {
    if (error.domain() != kSqliteErrorDomain)
        return true;
    switch (error.code() & 0xff) {
        case SQLITE_NOMEM:
        case SQLITE_FULL:
        case SQLITE_BUSY:
        case SQLITE_LOCKED:
        case SQLITE_INTERRUPT:
            return true;
        default:
            return false;
    }
}

}  // namespace

// ---- Opening ----

Result<std::unique_ptr<TremorStore>> TremorStore::open(
    const std::string& stateDir, uint64_t fsid, const TremorStoreDirectory::LockWait& lockWait) {
    auto dir = TremorStoreDirectory::acquire(stateDir, fsid, lockWait);
    if (!dir.ok())
        return dir.error();
    std::unique_ptr<TremorStore> store(new TremorStore(std::move(dir).value()));
    Status status = store->load();
    if (status.ok())
        return store;

    std::string database = store->dir_->databasePath();
    if (isTransient(status.error())) {
        const int code = status.error().code() & 0xff;
        const bool held = status.error().domain() == std::string_view(kSqliteErrorDomain) &&
                          (code == SQLITE_BUSY || code == SQLITE_LOCKED);
        // Tamber processes take turns through the directory lock, so this is another program
        // (a backup, an sqlite3 shell) that kept the database past the busy timeout.
        std::string why = status.error().description();
        if (held)
            why = "another program holds it; try again once it lets go (" + why + ")";
        logError("Cannot open the event journal " + database + ": " + why);
        return status.error();
    }
    logError("The event journal " + database + " is unusable (" + status.error().description() +
             "); moving it aside and starting a new one");
    store->index_.reset();
    store->roots_.reset();
    store->db_.reset();
    auto moved = store->dir_->moveDatabaseAside();
    if (!moved.ok())
        return moved.error();
    status = store->load();
    if (!status.ok()) {
        logError("Cannot create the event journal " + database + ": " +
                 status.error().description());
        return status.error();
    }
    return store;
}

TremorStore::~TremorStore() {
    std::lock_guard lock(mutex_);
    index_.reset();
    roots_.reset();
    db_.reset();  // before the directory lock goes
}

Status TremorStore::load() {
    dir_->removeOrphanedSidecars();
    auto db = SqliteDatabase::open(dir_->databasePath());
    if (!db.ok())
        return db.error();
    db_ = std::move(db).value();
    roots_ = std::make_unique<WatchedRoots>(*db_);
    index_ = std::make_unique<InodeIndex>(*db_);
    if (Status status = TremorStoreSchema::prepare(*db_, dir_->path()); !status.ok())
        return status;
    return readState();
}

Status TremorStore::readState() {
    auto meta = db_->prepare("SELECT uuid, next_event_id, oldest_event_id FROM meta WHERE id = 1");
    if (!meta.ok())
        return meta.error();
    auto row = meta->step();
    if (!row.ok())
        return row.error();
    if (!row.value())
        return corrupt("no meta row");
    uuid_ = meta->columnText(0);
    int64_t next = meta->columnInt64(1), oldest = meta->columnInt64(2);
    meta->reset();
    if (uuid_.size() != 36 || next < 1 || oldest < 1 || oldest > next) {
        return corrupt("inconsistent meta row");
    }
    // Rows beyond the counter would make the next append reuse their IDs.
    auto range = db_->prepare("SELECT min(id), max(id) FROM events");
    if (!range.ok())
        return range.error();
    if (auto r = range->step(); !r.ok())
        return r.error();
    if (!range->columnIsNull(0) &&
        (range->columnInt64(0) < oldest || range->columnInt64(1) >= next)) {
        return corrupt("events outside the kept range");
    }
    if (Status status = index_->load(); !status.ok())
        return status;
    nextEventId_ = fromSqlite(next);
    oldestEventId_ = fromSqlite(oldest);
    return roots_->load();
}

uint64_t TremorStore::lastEventId() const {
    std::lock_guard lock(mutex_);
    return nextEventId_ - 1;
}

uint64_t TremorStore::oldestEventId() const {
    std::lock_guard lock(mutex_);
    return oldestEventId_;
}

Status TremorStore::transact(const std::function<Status()>& work) {
    std::lock_guard lock(mutex_);
    const uint64_t nextEventId = nextEventId_;
    Status status;
    {
        auto txn = db_->begin();
        if (!txn.ok())
            return txn.error();
        status = work();
        if (status.ok())
            status = txn->commit();
    }  // rolled back unless committed
    if (!status.ok()) {
        // The counters go back with the rows: IDs not written were never handed out.
        nextEventId_ = nextEventId;
        if (Status reloaded = index_->load(); !reloaded.ok())
            logError("Cannot reread the document-ID counter: " + reloaded.error().description());
    }
    return status;
}

Status TremorStore::capSizeForTesting(bool capped) {
    std::lock_guard lock(mutex_);
    auto pages = db_->queryInt64("PRAGMA page_count");
    if (!pages.ok())
        return pages.error();
    return db_->exec("PRAGMA max_page_count = " +
                     std::to_string(capped ? pages.value() : int64_t{0xfffffffe}));
}

// ---- Journal ----

Result<uint64_t> TremorStore::append(std::vector<JournalEvent>& events) {
    std::lock_guard lock(mutex_);
    if (events.empty())
        return nextEventId_ - 1;
    if (events.size() > kLastEventId + 1 - nextEventId_) {
        std::string description = "The event journal in " + dir_->path() +
                                  " has used every event ID; it journals nothing more";
        logError(description);
        return Error(kPosixErrorDomain, EOVERFLOW, {{"description", std::move(description)}});
    }
    auto txn = db_->begin();
    if (!txn.ok())
        return txn.error();
    auto insert =
        db_->cached("INSERT INTO events(id, root, path, file_id, flags) VALUES(?, ?, ?, ?, ?)");
    if (!insert.ok())
        return insert.error();
    uint64_t id = nextEventId_;
    for (const JournalEvent& event : events) {
        insert->bind(1, toSqlite(id++))
            .bind(2, toSqlite(roots_->idFor(event.path)))
            .bind(3, event.path)
            .bind(4, toSqlite(event.fileID))
            .bind(5, static_cast<int64_t>(event.flags));
        if (Status status = insert->run(); !status.ok())
            return status.error();
    }
    auto meta = db_->cached("UPDATE meta SET next_event_id = ? WHERE id = 1");
    if (!meta.ok())
        return meta.error();
    if (Status status = meta->bind(1, toSqlite(id)).run(); !status.ok())
        return status.error();
    if (Status status = txn->commit(); !status.ok())
        return status.error();
    for (JournalEvent& event : events) event.id = nextEventId_++;
    return nextEventId_ - 1;
}

// Reads one root's events (or all events, for root -1) in ID order, a chunk at a time.
struct TremorStore::Cursor {
    int64_t root;
    uint64_t after;
    std::vector<JournalEvent> buffered;
    size_t next = 0;  // the first of `buffered` not yet delivered
    bool exhausted = false;
    size_t limit = 0;  // rows of the next read

    bool empty() const { return next == buffered.size(); }
    const JournalEvent& front() const { return buffered[next]; }
};

Status TremorStore::fetch(Cursor& cursor, size_t chunk, uint64_t upTo) {
    std::lock_guard lock(mutex_);
    // The planner prefers the primary key for "ORDER BY id"; for one root the index is far
    // cheaper, so it is forced.
    auto stmt = cursor.root < 0 ? db_->cached(
                                      "SELECT id, path, file_id, flags FROM events "
                                      "WHERE id > ?1 AND id <= ?2 ORDER BY id LIMIT ?3")
                                : db_->cached(
                                      "SELECT id, path, file_id, flags FROM events "
                                      "INDEXED BY events_by_root WHERE root = ?4 "
                                      "AND id > ?1 AND id <= ?2 ORDER BY id LIMIT ?3");
    if (!stmt.ok())
        return stmt.error();
    cursor.buffered.clear();
    cursor.next = 0;
    stmt->bind(1, toSqlite(cursor.after)).bind(2, toSqlite(upTo)).bind(3, toSqlite(chunk));
    if (cursor.root >= 0)
        stmt->bind(4, cursor.root);
    size_t rows = 0;
    Result<bool> r = stmt->step();
    for (; r.ok() && r.value(); r = stmt->step(), ++rows) {
        cursor.buffered.push_back({fromSqlite(stmt->columnInt64(0)), stmt->columnText(1),
                                   fromSqlite(stmt->columnInt64(2)),
                                   static_cast<uint32_t>(stmt->columnInt64(3))});
    }
    if (!r.ok())
        return r.error();
    if (rows < chunk)
        cursor.exhausted = true;
    if (!cursor.buffered.empty())
        cursor.after = cursor.buffered.back().id;
    return Status::OK();
}

Status TremorStore::replay(uint64_t sinceExclusive, const std::vector<std::string>& paths,
                           size_t chunk, const std::function<bool(const JournalEvent&)>& each) {
    if (chunk == 0)
        chunk = kDefaultReplayChunk;
    std::vector<std::string> wanted;
    for (const std::string& path : paths) wanted.push_back(WatchedRoots::normalised(path));
    bool everything = wanted.empty() || std::count(wanted.begin(), wanted.end(), "/") > 0;

    std::vector<Cursor> cursors;
    uint64_t upTo;
    {
        std::lock_guard lock(mutex_);
        upTo = nextEventId_ - 1;
        // Nothing comes after it. Returning here also keeps an ID of 2^63 or more away from
        // SQLite, whose keys are signed: bound as it is, it would read as a negative number
        // and replay the whole journal.
        if (sinceExclusive >= upTo)
            return Status::OK();
        if (!everything) {
            // Once each: a damaged roots table may name one root twice, and two cursors over
            // one root would hand out its events twice.
            std::vector<uint64_t> roots = roots_->mayHoldEventsBelow(wanted);
            std::sort(roots.begin(), roots.end());
            roots.erase(std::unique(roots.begin(), roots.end()), roots.end());
            for (uint64_t root : roots) cursors.push_back({toSqlite(root), sinceExclusive, {}});
        }
    }
    // Every root involved: one scan in ID order is cheaper than merging them all.
    if (cursors.empty())
        cursors.push_back({-1, sinceExclusive, {}});

    auto matches = [&](const std::string& path) {
        if (everything)
            return true;
        for (const std::string& base : wanted) {
            if (WatchedRoots::isAtOrBelow(path, base))
                return true;
        }
        return false;
    };
    uint64_t delivered = sinceExclusive;
    while (true) {
        Cursor* next = nullptr;
        for (Cursor& cursor : cursors) {
            if (cursor.empty() && !cursor.exhausted) {
                cursor.limit = cursor.limit == 0 ? std::min(chunk, kFirstReplayRead)
                                                 : std::min(chunk, cursor.limit * 2);
                if (Status status = fetch(cursor, cursor.limit, upTo); !status.ok())
                    return status;
            }
            if (!cursor.empty() && (!next || cursor.front().id < next->front().id)) {
                next = &cursor;
            }
        }
        if (!next)
            return Status::OK();
        const JournalEvent& event = next->buffered[next->next++];
        // Never backwards nor twice, whatever a damaged journal holds.
        if (event.id <= delivered)
            continue;
        delivered = event.id;
        if (matches(event.path) && !each(event))
            return Status::OK();
    }
}

TremorStore::ReplayCheck TremorStore::replayability(uint64_t sinceEventId,
                                                    const std::vector<std::string>& paths) const {
    std::lock_guard lock(mutex_);
    uint64_t last = nextEventId_ - 1;
    if (sinceEventId > last) {
        return {false, "event " + std::to_string(sinceEventId) + " is past the last event " +
                           std::to_string(last) + " of this journal"};
    }
    if (sinceEventId + 1 < oldestEventId_) {
        return {false, "events up to " + std::to_string(oldestEventId_ - 1) + " were trimmed"};
    }
    std::vector<std::string> wanted;
    for (const std::string& path : paths) wanted.push_back(WatchedRoots::normalised(path));
    if (wanted.empty())
        wanted.push_back("/");
    for (const std::string& path : wanted) {
        std::optional<uint64_t> watched = roots_->watchedSince(path);
        if (!watched)
            return {false, path + " is not under watch"};
        if (*watched > sinceEventId) {
            return {false, path + " came under watch at event " + std::to_string(*watched)};
        }
    }
    return {true, {}};
}

Status TremorStore::trim(uint64_t keepAtMost) {
    std::lock_guard lock(mutex_);
    uint64_t last = nextEventId_ - 1;
    uint64_t oldest = last >= keepAtMost ? last - keepAtMost + 1 : 1;
    if (oldest <= oldestEventId_)
        return Status::OK();
    auto txn = db_->begin();
    if (!txn.ok())
        return txn.error();
    auto erase = db_->cached("DELETE FROM events WHERE id < ?");
    if (!erase.ok())
        return erase.error();
    if (Status status = erase->bind(1, toSqlite(oldest)).run(); !status.ok())
        return status;
    auto meta = db_->cached("UPDATE meta SET oldest_event_id = ? WHERE id = 1");
    if (!meta.ok())
        return meta.error();
    if (Status status = meta->bind(1, toSqlite(oldest)).run(); !status.ok())
        return status;
    if (Status status = txn->commit(); !status.ok())
        return status;
    oldestEventId_ = oldest;
    return Status::OK();
}

// ---- Roots ----

Status TremorStore::addRoot(const std::string& path, uint64_t sinceEventId, uint64_t inode) {
    std::lock_guard lock(mutex_);
    return roots_->add(path, sinceEventId, inode);
}

Status TremorStore::setRootInode(const std::string& path, uint64_t inode) {
    std::lock_guard lock(mutex_);
    return roots_->setInode(path, inode);
}

Status TremorStore::removeRoot(const std::string& path) {
    std::lock_guard lock(mutex_);
    return roots_->remove(path);
}

bool TremorStore::resumeRoot(const std::string& path) {
    std::lock_guard lock(mutex_);
    return roots_->resume(path);
}

void TremorStore::releaseRoot(const std::string& path) {
    std::lock_guard lock(mutex_);
    roots_->release(path);
}

Result<std::vector<std::string>> TremorStore::retireRoots() {
    std::lock_guard lock(mutex_);
    return roots_->retire();
}

Result<TremorStore::Forgotten> TremorStore::forgetRoot(const std::string& rawPath) {
    std::lock_guard lock(mutex_);
    std::string path = WatchedRoots::normalised(rawPath);
    auto forgotten = roots_->forget(path);
    if (!forgotten.ok())
        return forgotten.error();
    Forgotten outcome;
    uint64_t top = forgotten.value().top;
    if (top == 0)
        return outcome;
    auto tree = index_->subtree(top, std::move(forgotten.value().kept));
    if (!tree.ok())
        return tree.error();
    std::vector<uint64_t> gone;
    std::vector<uint32_t> documents;
    for (const InodeRecord& record : tree.value()) {
        gone.push_back(record.inode);
        if (record.docID != 0)
            documents.push_back(record.docID);
    }
    outcome.entries = gone.size();
    gone.push_back(top);
    auto topDocument = index_->documentIdForInode(top);
    if (topDocument.ok() && topDocument.value())
        documents.push_back(*topDocument.value());
    Status status = transact([&]() -> Status {
        if (Status removed = index_->remove(gone); !removed.ok())
            return removed;
        for (uint32_t docID : documents) {
            if (Status cleared = index_->clearDocumentId(docID); !cleared.ok())
                return cleared;
        }
        return Status::OK();
    });
    if (!status.ok())
        return status.error();
    outcome.documents = documents.size();
    return outcome;
}

std::vector<TremorStore::Root> TremorStore::roots() const {
    std::lock_guard lock(mutex_);
    return roots_->watched();
}

std::vector<TremorStore::Root> TremorStore::rememberedRoots() const {
    std::lock_guard lock(mutex_);
    return roots_->remembered();
}

bool TremorStore::knowsRoot(const std::string& path) const {
    std::lock_guard lock(mutex_);
    return roots_->knows(path);
}

// ---- Index of the watched trees and document IDs ----

Status TremorStore::upsertInodes(const std::vector<InodeRecord>& records) {
    std::lock_guard lock(mutex_);
    return index_->upsert(records);
}

Status TremorStore::removeInodes(const std::vector<uint64_t>& inodes) {
    std::lock_guard lock(mutex_);
    return index_->remove(inodes);
}

Result<std::optional<InodeRecord>> TremorStore::inode(uint64_t inode) const {
    std::lock_guard lock(mutex_);
    return index_->find(inode);
}

Result<std::optional<std::string>> TremorStore::pathForInode(uint64_t inode) const {
    std::lock_guard lock(mutex_);
    return index_->path(inode,
                        [this](uint64_t candidate) { return roots_->pathOfRootInode(candidate); });
}

Result<std::vector<InodeRecord>> TremorStore::children(uint64_t parent) const {
    std::lock_guard lock(mutex_);
    return index_->children(parent);
}

Result<std::vector<InodeRecord>> TremorStore::childrenNamed(uint64_t parent,
                                                            const std::string& name) const {
    std::lock_guard lock(mutex_);
    return index_->childrenNamed(parent, name);
}

Result<uint32_t> TremorStore::allocateDocumentId(uint64_t inode) {
    std::lock_guard lock(mutex_);
    return index_->allocateDocumentId(inode);
}

Result<std::vector<TremorStore::Placement>> TremorStore::placeInodes(
    const std::vector<uint64_t>& inodes) const {
    std::lock_guard lock(mutex_);
    return index_->place(inodes,
                         [this](uint64_t candidate) { return roots_->pathOfRootInode(candidate); });
}

Result<std::vector<uint32_t>> TremorStore::allocateDocumentIds(
    const std::vector<NewDocument>& documents) {
    std::lock_guard lock(mutex_);
    return index_->allocateDocumentIds(documents);
}

Result<std::optional<uint64_t>> TremorStore::inodeForDocumentId(uint32_t docID) const {
    std::lock_guard lock(mutex_);
    return index_->inodeForDocumentId(docID);
}

Result<std::optional<uint32_t>> TremorStore::documentIdForInode(uint64_t inode) const {
    std::lock_guard lock(mutex_);
    return index_->documentIdForInode(inode);
}

Status TremorStore::moveDocumentId(uint32_t docID, uint64_t newInode) {
    std::lock_guard lock(mutex_);
    return index_->moveDocumentId(docID, newInode);
}

Status TremorStore::detachDocumentId(uint32_t docID) {
    std::lock_guard lock(mutex_);
    return index_->detachDocumentId(docID);
}

Status TremorStore::clearDocumentId(uint32_t docID) {
    std::lock_guard lock(mutex_);
    return index_->clearDocumentId(docID);
}

Result<TremorStore::Attributes> TremorStore::documentAttributes(uint32_t docID) const {
    std::lock_guard lock(mutex_);
    return index_->documentAttributes(docID);
}

Status TremorStore::setDocumentAttribute(uint32_t docID, const std::string& name,
                                         const std::optional<Bytes>& value) {
    std::lock_guard lock(mutex_);
    return index_->setDocumentAttribute(docID, name, value);
}

Status TremorStore::replaceDocumentAttributes(uint32_t docID, const Attributes& attributes) {
    std::lock_guard lock(mutex_);
    return index_->replaceDocumentAttributes(docID, attributes);
}

}  // namespace tamber
