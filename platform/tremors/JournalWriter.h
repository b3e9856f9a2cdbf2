#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/tremors/FileChange.h"
#include "platform/tremors/InodeRecord.h"
#include "platform/tremors/JournalEvent.h"
#include "platform/tremors/TremorStore.h"
#include "support/Result.h"

namespace tamber {

// Turns the changes seen in one volume's watched trees into journal events, and keeps that
// volume's inode index and document IDs in step with them: each batch, with its index changes,
// is one transaction. Used from one thread at a time.
//
// Document IDs follow the document: when a file with an ID vanishes from a path and another
// inode appears at that path in the same batch (a safe save), the ID moves to the new inode and
// "/.docid/<dev>/changed/<id>/src=<old>,dst=<new>" is journaled; when it just vanishes, the same
// path with dst=0 is journaled and the ID is cleared. A file is its inode number and its birth
// time: a number given again to a new file is a new file. The document's metadata attributes
// follow it too: the index keeps a copy, refreshed when the file's attributes change, and a new
// inode that lacks them is given them.
class JournalWriter {
public:
    JournalWriter(TremorStore& store, uint32_t device) : store_(store), device_(device) {}

    // Journals one batch in one append; returns the appended events with their IDs.
    Result<std::vector<JournalEvent>> apply(const std::vector<FileChange>& changes);
    // Journals one event with `flags` (dropped, must scan) on each of `paths`.
    Result<std::vector<JournalEvent>> journalDropped(const std::vector<std::string>& paths,
                                                     uint32_t flags);
    // Compares the tree at `root` with the index and brings the index up to date. With
    // `journal`, what differs is journaled as it would have been by live watching (a tree that
    // is indexed for the first time is not).
    Result<std::vector<JournalEvent>> reconcile(const std::string& root, bool journal);
    // The same for several roots at once, in one batch: a file that moved from one to another
    // while nothing watched is the same file, and a document keeps its ID. Roots that cannot be
    // read are passed over; the error of the last one is returned when none could.
    Result<std::vector<JournalEvent>> reconcile(const std::vector<std::string>& roots,
                                                bool journal);
    // The same for the indexed folder `inode` inside a root (one that could not be watched),
    // journaling what differs. ENOENT when the index no longer has that folder.
    Result<std::vector<JournalEvent>> rescan(uint64_t inode);

    static std::string documentIdPath(uint32_t device, uint32_t docID, uint64_t src, uint64_t dst);

private:
    struct Found {
        InodeRecord record;
        std::string path;
    };

    void created(const FileChange& change);
    void removed(const FileChange& change);
    void renamed(const FileChange& change);
    void touched(const FileChange& change, uint32_t flag);
    // A tree to compare: its path, its folder on disk and the folder the index has for it.
    struct Tree {
        std::string path;
        uint64_t top = 0;
        uint64_t oldTop = 0;
    };
    // Walks the trees on disk and compares them with the index's trees, in one batch.
    Result<std::vector<JournalEvent>> crawl(const std::vector<Tree>& trees, bool journal);
    // Adds what is on disk below `at` (the folder `top`) to `onDisk`.
    static void walk(const std::string& at, uint64_t top, std::map<uint64_t, Found>& onDisk);
    void compareWithIndex(const std::vector<Tree>& trees, std::map<uint64_t, Found>& onDisk,
                          bool journal);
    // What becomes of documents whose files vanished and were not claimed in the batch: cleared,
    // or first given to the file at their path, if it has no ID of its own.
    enum class Settle { Clear, ClaimByPath };
    // Runs `work`, then journals what it left pending, all in one transaction.
    Result<std::vector<JournalEvent>> commit(Settle settle, const std::function<void()>& work);

    // Index entries of the batch are written together: at its end, or before the index is read
    // in a way that staged entries could not answer.
    void stage(InodeRecord record);
    void flushStaged();
    std::optional<InodeRecord> stagedOrIndexed(uint64_t inode);
    // The entries named `name` in the directory `parent`, staged or indexed.
    std::vector<InodeRecord> entriesAt(uint64_t parent, const std::string& name);
    // The indexed entry at `path`, by walking the index down from the root above it.
    std::optional<InodeRecord> recordAt(const std::string& path);
    // A batch is applied after the fact: the file it finds at a path may have an inode number
    // that the index still gives to a file that was deleted or replaced meanwhile. That file is
    // forgotten, and its document waits for its own new file.
    void forgetReusedNumber(const struct statx& st);
    // Removes `top` and everything indexed below it; their document IDs wait in vanished_.
    void forgetSubtree(const InodeRecord& top, const std::string& path);
    // The document of `record` left its inode, which is gone or is another file now.
    void vanish(const InodeRecord& record, const std::string& path);
    // A safe save: the document that vanished from `path` in this batch is now `inode`, a new
    // entry of the same kind. Its metadata attributes that the new file lacks are written to it.
    void claimDocumentId(const std::string& path, uint64_t inode, uint8_t kind);
    void restoreAttributes(uint32_t docID, const std::string& path, uint64_t inode);
    // The document's metadata changed on its own inode: its copy becomes what the file holds.
    void refreshAttributes(uint32_t docID, const std::string& path, uint64_t inode);
    // Entries whose rename found the new name empty and that nothing in the batch placed
    // elsewhere: the file was renamed and then removed (or renamed out of sight) before the batch
    // was applied. Left in place they would name a file that is gone, and its document's
    // deletion would never be journaled.
    void settleMovedAway();
    // Clears the document IDs of files that vanished for good and journals their deletion.
    void settleVanished(Settle settle);

    // A batch is all or nothing: the first index read or write that fails is logged and kept,
    // the rest of the batch runs on without effect, and commit() rolls the transaction back.
    void fail(const Status& status, std::string_view what);
    // The value read, or (after recording the failure) `fallback`.
    template <class T>
    T orFail(Result<T> read, T fallback);

    TremorStore& store_;
    const uint32_t device_;
    std::vector<JournalEvent> pending_;
    Status failure_;                               // of the batch being applied
    std::map<std::string, InodeRecord> vanished_;  // by path, only those with a document ID
    std::vector<std::pair<std::string, uint64_t>> movedAway_;  // (old path, inode)
    std::unordered_map<uint64_t, InodeRecord> staged_;
    std::map<std::pair<uint64_t, std::string>, uint64_t> stagedNames_;  // (parent, name) -> inode
};

}  // namespace tamber
