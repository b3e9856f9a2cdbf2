#include "platform/tremors/JournalWriter.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <set>
#include <string_view>
#include <utility>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "platform/UrlPath.h"
#include "platform/strata/DocumentAttributes.h"
#include "platform/tremors/FileStamp.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Log.h"

namespace tamber {

std::string JournalWriter::documentIdPath(uint32_t device, uint32_t docID, uint64_t src,
                                          uint64_t dst) {
    return std::string(TremorStore::kDocumentIdRoot) + "/" + std::to_string(device) + "/changed/" +
           std::to_string(docID) + "/src=" + std::to_string(src) + ",dst=" + std::to_string(dst);
}

Result<std::vector<JournalEvent>> JournalWriter::apply(const std::vector<FileChange>& changes) {
    return commit(Settle::ClaimByPath, [&] {
        for (const FileChange& change : changes) {
            switch (change.kind) {
                case FileChange::Kind::Created:
                    created(change);
                    break;
                case FileChange::Kind::Removed:
                    removed(change);
                    break;
                case FileChange::Kind::Renamed:
                    renamed(change);
                    break;
                case FileChange::Kind::Modified:
                    touched(change, kTremorItemModified);
                    break;
                case FileChange::Kind::AttributesChanged:
                    touched(change, kTremorItemAttributes);
                    break;
                case FileChange::Kind::Overflow:
                case FileChange::Kind::WatchFailed:
                    // The service journals these for the roots they affect.
                    break;
            }
        }
    });
}

Result<std::vector<JournalEvent>> JournalWriter::journalDropped(
    const std::vector<std::string>& paths, uint32_t flags) {
    for (const auto& path : paths) pending_.push_back({0, path, 0, flags});
    return commit(Settle::Clear, [] {});
}

Result<std::vector<JournalEvent>> JournalWriter::commit(Settle settle,
                                                        const std::function<void()>& work) {
    std::vector<JournalEvent> events;
    // One transaction for the journal rows and the index: a crash keeps both or neither.
    failure_ = Status::OK();
    Status status = store_.transact([&]() -> Status {
        work();
        flushStaged();
        settleMovedAway();
        settleVanished(settle);
        if (!failure_.ok())
            return failure_;  // rolls back what the batch wrote before it failed
        events = std::move(pending_);
        if (events.empty())
            return Status::OK();
        auto last = store_.append(events);
        return last.ok() ? Status() : Status(last.error());
    });
    pending_.clear();
    vanished_.clear();
    movedAway_.clear();
    staged_.clear();
    stagedNames_.clear();
    failure_ = Status::OK();
    if (!status.ok())
        return status.error();
    return events;
}

// ---- Index entries of one batch ----

void JournalWriter::fail(const Status& status, std::string_view what) {
    if (status.ok())
        return;
    logError(std::string(what) + ": " + status.error().description());
    if (failure_.ok())
        failure_ = status;
}

template <class T>
T JournalWriter::orFail(Result<T> read, T fallback) {
    if (read.ok())
        return std::move(read).value();
    fail(read.status(), "Could not read the file index");
    return fallback;
}

void JournalWriter::stage(InodeRecord record) {
    auto [it, inserted] = staged_.try_emplace(record.inode, record);
    if (!inserted) {
        auto old = stagedNames_.find({it->second.parent, it->second.name});
        if (old != stagedNames_.end() && old->second == record.inode)
            stagedNames_.erase(old);
        it->second = record;
    }
    stagedNames_[{record.parent, record.name}] = record.inode;
}

void JournalWriter::flushStaged() {
    if (staged_.empty())
        return;
    std::vector<InodeRecord> records;
    records.reserve(staged_.size());
    for (auto& [inode, record] : staged_) {
        if (UrlPath::isEntryName(record.name))  // one odd name must not cost the batch
            records.push_back(std::move(record));
    }
    staged_.clear();
    stagedNames_.clear();
    fail(store_.upsertInodes(records), "Could not update the file index");
}

std::optional<InodeRecord> JournalWriter::stagedOrIndexed(uint64_t inode) {
    if (auto it = staged_.find(inode); it != staged_.end())
        return it->second;
    return orFail(store_.inode(inode), std::optional<InodeRecord>());
}

std::vector<InodeRecord> JournalWriter::entriesAt(uint64_t parent, const std::string& name) {
    std::vector<InodeRecord> found;
    if (auto it = stagedNames_.find({parent, name}); it != stagedNames_.end())
        found.push_back(staged_.at(it->second));
    for (auto& record : orFail(store_.childrenNamed(parent, name), std::vector<InodeRecord>())) {
        if (!staged_.contains(record.inode))  // else the staged entry is newer
            found.push_back(std::move(record));
    }
    return found;
}

std::optional<InodeRecord> JournalWriter::recordAt(const std::string& path) {
    flushStaged();
    const TremorStore::Root* best = nullptr;
    auto roots = store_.roots();
    for (const auto& root : roots) {
        if (root.inode != 0 && WatchedRoots::isAtOrBelow(path, root.path) &&
            (!best || root.path.size() > best->path.size()))
            best = &root;
    }
    if (!best)
        return std::nullopt;
    if (path == best->path)
        return orFail(store_.inode(best->inode), std::optional<InodeRecord>());
    std::string_view rest(path);
    rest.remove_prefix(best->path == "/" ? 1 : best->path.size() + 1);
    uint64_t parent = best->inode;
    std::optional<InodeRecord> found;
    while (!rest.empty()) {
        size_t slash = rest.find('/');
        std::string name(rest.substr(0, slash));
        rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash + 1);
        auto entries = orFail(store_.childrenNamed(parent, name), std::vector<InodeRecord>());
        if (entries.empty())
            return std::nullopt;
        // Lost events may leave a stale twin behind; only a directory can be walked into.
        found = std::move(entries.front());
        for (auto& entry : entries) {
            if (!rest.empty() && entry.kind == InodeRecord::kDirectory) {
                found = std::move(entry);
                break;
            }
        }
        parent = found->inode;
    }
    return found;
}

void JournalWriter::forgetSubtree(const InodeRecord& top, const std::string& path) {
    flushStaged();
    std::vector<uint64_t> gone;
    std::vector<std::pair<InodeRecord, std::string>> stack{{top, path}};
    while (!stack.empty()) {
        auto [record, at] = std::move(stack.back());
        stack.pop_back();
        gone.push_back(record.inode);
        if (auto docID =
                orFail(store_.documentIdForInode(record.inode), std::optional<uint32_t>())) {
            record.docID = *docID;
            vanish(record, at);
        }
        if (record.kind == InodeRecord::kDirectory) {
            for (auto& child : orFail(store_.children(record.inode), std::vector<InodeRecord>()))
                stack.emplace_back(child, at + "/" + child.name);
        }
    }
    fail(store_.removeInodes(gone), "Could not update the file index");
}

void JournalWriter::forgetReusedNumber(const struct statx& st) {
    // Without a birth time a reused number cannot be told from a move whose event was lost.
    if (!FileStamp::hasBirthTime(st))
        return;
    auto indexed = stagedOrIndexed(st.stx_ino);
    if (!indexed || FileStamp::isIndexedFile(*indexed, st))
        return;
    flushStaged();
    // Its document waits under its old path for its own new file, later in the batch.
    forgetSubtree(*indexed, orFail(store_.pathForInode(st.stx_ino), std::optional<std::string>())
                                .value_or(std::string()));
}

// ---- Document IDs ----

void JournalWriter::vanish(const InodeRecord& record, const std::string& path) {
    // Detached at once: the inode number may already belong to the file that takes another
    // document's place in this batch.
    fail(store_.detachDocumentId(record.docID), "Could not detach a document ID");
    vanished_[path] = record;
}

void JournalWriter::claimDocumentId(const std::string& path, uint64_t inode, uint8_t kind) {
    auto it = vanished_.find(path);
    if (it == vanished_.end() || it->second.kind != kind)
        return;
    uint32_t docID = it->second.docID;
    uint64_t old = it->second.inode;
    if (auto own = orFail(store_.documentIdForInode(inode), std::optional<uint32_t>())) {
        logDebug([&] {
            return "document " + std::to_string(docID) + " is not claimed at " + path + ": inode " +
                   std::to_string(inode) + " is document " + std::to_string(*own);
        });
        return;  // the new file is a document of its own
    }
    vanished_.erase(it);
    if (Status moved = store_.moveDocumentId(docID, inode); !moved.ok()) {
        fail(moved, "Could not move document ID " + std::to_string(docID));
        return;
    }
    pending_.push_back({0, documentIdPath(device_, docID, old, inode), inode,
                        kTremorItemRenamed | kTremorItemIsFile});
    restoreAttributes(docID, path, inode);
}

void JournalWriter::restoreAttributes(uint32_t docID, const std::string& path, uint64_t inode) {
    auto saved = orFail(store_.documentAttributes(docID), TremorStore::Attributes());
    if (saved.empty())
        return;  // the common case costs no file-system call
    auto kept = DocumentAttributes::restore(path, inode, saved);
    if (kept && *kept != saved) {
        fail(store_.replaceDocumentAttributes(docID, *kept),
             "Could not update a document's metadata");
    }
}

void JournalWriter::refreshAttributes(uint32_t docID, const std::string& path, uint64_t inode) {
    auto values = DocumentAttributes::read(path);
    struct statx st {};
    // Read by path: if another file took the path meanwhile, what was read is not this one's.
    if (!values || !FileStamp::read(path, st) || st.stx_ino != inode)
        return;
    auto saved = store_.documentAttributes(docID);
    if (!saved.ok()) {
        fail(saved.status(), "Could not read a document's metadata");
        return;
    }
    if (*values != saved.value()) {
        fail(store_.replaceDocumentAttributes(docID, *values),
             "Could not update a document's metadata");
    }
}

void JournalWriter::settleMovedAway() {
    // The entry stays where it is until the batch ends: a later rename in it may find the file
    // at its next name, or a new file at the old name may be a safe save that claims the
    // document.
    for (const auto& [path, inode] : movedAway_) {
        auto record = orFail(store_.inode(inode), std::optional<InodeRecord>());
        if (!record)
            continue;  // forgotten already: replaced or claimed
        auto indexedAt = orFail(store_.pathForInode(inode), std::optional<std::string>());
        if (indexedAt != path)
            continue;  // found again at another name
        struct statx st {};
        if (FileStamp::read(path, st) && FileStamp::isIndexedFile(*record, st))
            continue;  // renamed back
        forgetSubtree(*record, path);
    }
    movedAway_.clear();
}

void JournalWriter::settleVanished(Settle settle) {
    if (settle == Settle::ClaimByPath) {
        // Events are applied after the fact: the file that took a document's place may be at its
        // path already while its own event is still to come, in a later batch.
        // That file's inode number may still be indexed for an older file, whose document then
        // waits for its own path in turn: each path is tried once.
        std::set<std::string> tried;
        for (bool more = true; more;) {
            more = false;
            std::vector<std::string> waiting;
            for (const auto& [path, record] : vanished_) {
                if (!path.empty() && tried.insert(path).second)
                    waiting.push_back(path);
            }
            for (const std::string& path : waiting) {
                struct statx st {};
                if (!FileStamp::read(path, st))
                    continue;
                more = true;
                forgetReusedNumber(st);
                claimDocumentId(path, st.stx_ino, FileStamp::kindOf(st.stx_mode));
            }
        }
    }
    for (auto& [path, record] : vanished_) {
        fail(store_.clearDocumentId(record.docID), "Could not clear a document ID");
        pending_.push_back({0, documentIdPath(device_, record.docID, record.inode, 0), record.inode,
                            kTremorItemRemoved | kTremorItemIsFile});
    }
    vanished_.clear();
}

// ---- Live changes ----

void JournalWriter::created(const FileChange& change) {
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    struct statx st {};
    struct statx parent {};
    if (!FileStamp::read(change.path, st) ||
        !FileStamp::read(std::string(UrlPath::deletingLastComponent(change.path)), parent)) {
        // Gone already; its removal follows in this batch or the next.
        pending_.push_back({0, change.path, 0, kTremorItemCreated | kind});
        return;
    }
    std::string name = std::string(UrlPath::lastComponent(change.path));
    for (const InodeRecord& existing : entriesAt(parent.stx_ino, name)) {
        if (!FileStamp::isIndexedFile(existing, st))
            forgetSubtree(existing, change.path);
    }
    forgetReusedNumber(st);
    // A file the index knows at another place was moved here: the kernel reports such a move as
    // a removal and, through the listing of the new folder, a creation when the folder it went
    // to was not watched yet. Journaled as the move it is, so that it can be followed.
    std::optional<std::string> movedFrom;
    if (auto indexed = stagedOrIndexed(st.stx_ino);
        indexed && FileStamp::isIndexedFile(*indexed, st) &&
        (indexed->parent != parent.stx_ino || indexed->name != name)) {
        flushStaged();
        movedFrom = orFail(store_.pathForInode(st.stx_ino), std::optional<std::string>());
    }
    InodeRecord record = FileStamp::recordOf(st, parent.stx_ino, std::move(name));
    uint8_t recordKind = record.kind;
    stage(std::move(record));
    const uint32_t kindFlag = FileStamp::kindFlag(recordKind);
    if (movedFrom) {
        pending_.push_back({0, *movedFrom, st.stx_ino, kTremorItemRenamed | kindFlag});
        pending_.push_back({0, change.path, st.stx_ino, kTremorItemRenamed | kindFlag});
    } else {
        pending_.push_back({0, change.path, st.stx_ino, kTremorItemCreated | kindFlag});
    }
    claimDocumentId(change.path, st.stx_ino, recordKind);
}

void JournalWriter::removed(const FileChange& change) {
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    auto record = recordAt(change.path);
    uint64_t inode = 0;
    if (record) {
        inode = record->inode;
        kind = FileStamp::kindFlag(record->kind);
        forgetSubtree(*record, change.path);
    }
    pending_.push_back({0, change.path, inode, kTremorItemRemoved | kind});
}

void JournalWriter::renamed(const FileChange& change) {
    auto from = change.fromPath.empty() ? std::nullopt : recordAt(change.fromPath);
    struct statx st {};
    struct statx parent {};
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    uint64_t inode = from ? from->inode : 0;
    bool present =
        FileStamp::read(change.path, st) &&
        FileStamp::read(std::string(UrlPath::deletingLastComponent(change.path)), parent);
    if (present)
        inode = st.stx_ino;
    std::vector<InodeRecord> existing;
    if (present) {
        existing = entriesAt(parent.stx_ino, std::string(UrlPath::lastComponent(change.path)));
    } else if (auto at = recordAt(change.path)) {
        existing.push_back(std::move(*at));
    }
    for (const InodeRecord& replaced : existing) {
        if (present ? !FileStamp::isIndexedFile(replaced, st) : replaced.inode != inode)
            forgetSubtree(replaced, change.path);
    }
    if (present) {
        forgetReusedNumber(st);
        InodeRecord record = FileStamp::recordOf(st, parent.stx_ino,
                                                 std::string(UrlPath::lastComponent(change.path)));
        kind = FileStamp::kindFlag(record.kind);
        stage(std::move(record));
    }
    if (!present && from)
        movedAway_.emplace_back(change.fromPath, from->inode);
    if (!change.fromPath.empty())
        pending_.push_back({0, change.fromPath, inode, kTremorItemRenamed | kind});
    pending_.push_back({0, change.path, inode, kTremorItemRenamed | kind});
    if (present)
        claimDocumentId(change.path, inode, FileStamp::kindOf(st.stx_mode));
}

void JournalWriter::touched(const FileChange& change, uint32_t flag) {
    struct statx st {};
    uint64_t inode = 0;
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    if (FileStamp::read(change.path, st)) {
        inode = st.stx_ino;
        kind = FileStamp::kindFlag(FileStamp::kindOf(st.stx_mode));
        // The index keeps up, so that a restart does not report the change again. Another file
        // that took the inode number is left to its own creation event.
        auto indexed = stagedOrIndexed(inode);
        if (indexed && indexed->name == std::string(UrlPath::lastComponent(change.path)) &&
            FileStamp::isIndexedFile(*indexed, st)) {
            InodeRecord now = FileStamp::recordOf(st, indexed->parent, indexed->name);
            if (FileStamp::differs(*indexed, now))
                stage(std::move(now));
            // Only documents keep a copy of their metadata: other files cost nothing here.
            if (flag == kTremorItemAttributes && indexed->kind == InodeRecord::kFile) {
                if (auto docID =
                        orFail(store_.documentIdForInode(inode), std::optional<uint32_t>()))
                    refreshAttributes(*docID, change.path, inode);
            }
        }
    }
    pending_.push_back({0, change.path, inode, flag | kind});
}

}  // namespace tamber
