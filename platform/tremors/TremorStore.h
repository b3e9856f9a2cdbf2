#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/tremors/InodeIndex.h"
#include "platform/tremors/InodeRecord.h"
#include "platform/tremors/JournalEvent.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorStoreDirectory.h"
#include "platform/tremors/TremorStoreSchema.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Result.h"

namespace tamber {

// The persistent state of one volume: the event journal, the watched roots, and the index of
// the watched trees (inode -> parent, name, kind) with the document IDs.
//
// Every call takes an internal mutex, so one writer thread and any number of readers may share
// a store. replay() releases it while its callback runs; transact() holds it throughout.
//
// Event IDs and document IDs come from counters kept in the database and updated in the same
// transaction as the rows that use them: neither is ever handed out twice, whatever was
// trimmed, cleared or lost in a crash.
class TremorStore {
public:
    using Root = WatchedRoots::Root;

    // Whether replaying from an event ID shows everything that happened since.
    struct ReplayCheck {
        bool complete = false;
        std::string reason;  // why not, for the log
    };

    static constexpr int kSchemaVersion = TremorStoreSchema::kVersion;
    static constexpr size_t kDefaultReplayChunk = 1000;
    // A client that wants a page of changes stops after a few hundred events: reading a full
    // chunk first would read (and copy) rows mostly thrown away.
    static constexpr size_t kFirstReplayRead = 250;
    static constexpr size_t kMaxPathComponents = InodeIndex::kMaxPathComponents;
    static constexpr const char* kDocumentIdRoot = kTremorDocumentIdRoot;

    // Opens <stateDir>/<fsid as 16 hex digits>/journal.sqlite, creating it when missing, and
    // upgrades a database of an older schema in place. A database that cannot be used (not a
    // database, failing its check, unknown schema) is logged, moved aside and replaced by a new
    // store with a new UUID: anchors into the old history then fail the UUID check, which is
    // what must happen.
    // Waits for another process that holds the store as `lockWait` says.
    static Result<std::unique_ptr<TremorStore>> open(
        const std::string& stateDir, uint64_t fsid,
        const TremorStoreDirectory::LockWait& lockWait = {});
    ~TremorStore();
    TremorStore(const TremorStore&) = delete;
    TremorStore& operator=(const TremorStore&) = delete;

    // Canonical upper-case 8-4-4-4-12, fixed for the life of the database.
    const std::string& uuid() const { return uuid_; }
    const std::string& directory() const { return dir_->path(); }
    // The last ID handed out; 0 for a new store.
    uint64_t lastEventId() const;
    // The oldest ID still kept (or the next one, when everything was trimmed).
    uint64_t oldestEventId() const;

    // Runs `work` as one transaction: the appends and index changes it makes from this thread are
    // all written, or (when it or the commit fails) none is, and no ID it used is handed out
    // again. Other threads wait until it is done. Roots must not change inside.
    Status transact(const std::function<Status()>& work);

    // ---- Journal ----

    // Assigns consecutive IDs to `events` and writes them in one transaction. Returns the last
    // ID. On failure nothing is written and no ID is used up.
    //
    // IDs never wrap: past kLastEventId the journal refuses every append (EOVERFLOW, logged)
    // rather than hand out an ID again, so kTremorEventIdsWrapped is never set. The limit is
    // below 2^64 - 1 because SQLite keys are signed and because that value means "now" to
    // streams; at a million events a second it is 290,000 years away.
    static constexpr uint64_t kLastEventId = INT64_MAX - 1;
    Result<uint64_t> append(std::vector<JournalEvent>& events);

    // Calls `each` for every event with `sinceExclusive` < id <= lastEventId() at the start of
    // the call whose path is at or below one of `paths` (by whole components), in ID order,
    // until `each` returns false; nothing when `sinceExclusive` is at or past the last ID,
    // whatever its value. Empty `paths` means the whole volume. Rows are read in growing
    // reads of up to `chunk` (0: the default), the first of kFirstReplayRead, and the lock is
    // not held while `each` runs, so it may call the store.
    Status replay(uint64_t sinceExclusive, const std::vector<std::string>& paths, size_t chunk,
                  const std::function<bool(const JournalEvent&)>& each);
    // Incomplete when events after `since` were trimmed, when `since` is not from this history,
    // or when a path is not under watch or came under watch after `since`.
    ReplayCheck replayability(uint64_t since, const std::vector<std::string>& paths) const;

    // Deletes the oldest events so that at most `keepAtMost` remain.
    Status trim(uint64_t keepAtMost);

    // ---- Roots ----

    // What forgetting a root dropped from the index.
    struct Forgotten {
        size_t entries = 0;    // index entries (files and folders)
        size_t documents = 0;  // document IDs, which no longer resolve
    };

    // Remembers that `path` is watched from event `sinceEventId` on, by this process (live).
    // Adding a watched root again changes nothing but a given inode; adding a removed,
    // unwatched or forgotten one starts its history anew.
    Status addRoot(const std::string& path, uint64_t sinceEventId, uint64_t inode = 0);
    Status setRootInode(const std::string& path, uint64_t inode);
    // The root stops being watched; its events stay replayable.
    Status removeRoot(const std::string& path);
    // A root that was watched until the last run stopped is watched again by this process,
    // with its history going on. False when it is not such a root.
    bool resumeRoot(const std::string& path);
    // This process stopped watching the root (or never managed to).
    void releaseRoot(const std::string& path);
    // Marks every watched root that this process does not watch unwatched, and returns them:
    // their history stops here, so a replay from before a later watch reports the gap.
    Result<std::vector<std::string>> retireRoots();
    // Marks the root forgotten and drops its tree from the index, with the document IDs of
    // what it held, so that none of it answers an identifier any more; its events stay. A tree
    // inside another remembered root keeps its entries (they are that root's too), and so do
    // remembered roots inside it. Fails with ENOENT when `path` is not remembered.
    Result<Forgotten> forgetRoot(const std::string& path);
    // Watched roots (including "/.docid"): those of this process and those of the last run.
    std::vector<Root> roots() const;
    // Every root not forgotten, watched or not.
    std::vector<Root> rememberedRoots() const;
    // Whether a root at `path` was ever added, forgotten or not.
    bool knowsRoot(const std::string& path) const;

    // ---- Index of the watched trees ----

    // Inserts or updates parent, name and kind; `docID` is ignored (document IDs change only
    // through the calls below, so that a crawl cannot drop them). Names must be real directory
    // entries: not empty, ".", ".." or containing '/'.
    Status upsertInodes(const std::vector<InodeRecord>& records);
    // Removes index entries. Document IDs are left in place: the caller decides whether the
    // document moved to another inode (moveDocumentId) or was deleted (clearDocumentId), and
    // journals that first.
    Status removeInodes(const std::vector<uint64_t>& inodes);
    // The reads below fail with the database's error rather than answer "nothing": an index
    // that could not be read is not an empty one.
    Result<std::optional<InodeRecord>> inode(uint64_t inode) const;
    // The absolute path, from the parent chain up to a root's inode. Nothing for inodes outside
    // the watched roots, broken or cyclic chains, or chains deeper than kMaxPathComponents.
    Result<std::optional<std::string>> pathForInode(uint64_t inode) const;
    Result<std::vector<InodeRecord>> children(uint64_t parent) const;
    // The entries indexed under that name in `parent`: one, unless events were lost.
    Result<std::vector<InodeRecord>> childrenNamed(uint64_t parent, const std::string& name) const;

    // ---- Document IDs ----

    // Where each of `inodes` is (as pathForInode) and its document ID (0: none), read under
    // one hold of the lock; the folders they share are walked once.
    using Placement = InodeIndex::Placement;
    Result<std::vector<Placement>> placeInodes(const std::vector<uint64_t>& inodes) const;

    // The inode's document ID, or the next one (from 1, never reused).
    Result<uint32_t> allocateDocumentId(uint64_t inode);
    // The same for each inode in order, in one transaction: the new IDs start with their
    // document's metadata copy, and when the transaction fails none is handed out.
    using NewDocument = InodeIndex::NewDocument;
    Result<std::vector<uint32_t>> allocateDocumentIds(const std::vector<NewDocument>& documents);
    Result<std::optional<uint64_t>> inodeForDocumentId(uint32_t docID) const;
    Result<std::optional<uint32_t>> documentIdForInode(uint64_t inode) const;
    // A safe save: the ID follows the document to `newInode` and the old inode loses it. Fails
    // when `newInode` already has another ID (clear that one first).
    Status moveDocumentId(uint32_t docID, uint64_t newInode);
    // The inode that held the ID is another file now; the ID waits, with its copy of the
    // metadata, to be moved to its document's new inode (or cleared).
    Status detachDocumentId(uint32_t docID);
    // The document was deleted; the ID is not handed out again and its metadata copy goes.
    Status clearDocumentId(uint32_t docID);

    // ---- Copies of the documents' metadata attributes (raw bytes by attribute name) ----

    using Attributes = InodeIndex::Attributes;
    Result<Attributes> documentAttributes(uint32_t docID) const;
    // Nothing as `value` drops that attribute from the copy.
    Status setDocumentAttribute(uint32_t docID, const std::string& name,
                                const std::optional<Bytes>& value);
    Status replaceDocumentAttributes(uint32_t docID, const Attributes& attributes);

    // Tests only: writes that would grow the database file past its current size fail with
    // SQLITE_FULL, as on a full disk; false lifts the cap again.
    Status capSizeForTesting(bool capped);

private:
    struct Cursor;

    explicit TremorStore(std::unique_ptr<TremorStoreDirectory> dir) : dir_(std::move(dir)) {}

    Status load();
    Status readState();
    Status fetch(Cursor& cursor, size_t chunk, uint64_t upTo);

    std::unique_ptr<TremorStoreDirectory> dir_;
    std::unique_ptr<SqliteDatabase> db_;
    std::unique_ptr<WatchedRoots> roots_;  // uses db_
    std::unique_ptr<InodeIndex> index_;    // uses db_
    // Guards the database and the two event-ID counters below (taken again by calls made with
    // it held); uuid_ is set when the store is opened, before it is shared.
    mutable std::recursive_mutex mutex_;
    std::string uuid_;
    uint64_t nextEventId_ = 1;
    uint64_t oldestEventId_ = 1;
};

}  // namespace tamber
