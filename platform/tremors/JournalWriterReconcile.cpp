// Reconciliation: the trees on disk compared with the index after the journal was away or
// lost events, and brought back in step with it.
#include <fcntl.h>
#include <sys/stat.h>

#include <map>
#include <set>
#include <string>
#include <vector>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "platform/tremors/FileStamp.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/TremorFlags.h"
#include "support/Log.h"

namespace tamber {

// ---- Reconciliation ----

Result<std::vector<JournalEvent>> JournalWriter::reconcile(const std::string& root, bool journal) {
    return reconcile(std::vector<std::string>{root}, journal);
}

Result<std::vector<JournalEvent>> JournalWriter::reconcile(const std::vector<std::string>& roots,
                                                           bool journal) {
    std::vector<Tree> trees;
    Status missing;
    for (const std::string& root : roots) {
        struct statx top {};
        if (!FileStamp::read(root, top)) {
            missing = Error::posix(errno);
            continue;
        }
        uint64_t oldTop = 0;
        for (const auto& r : store_.roots()) {
            if (r.path == root)
                oldTop = r.inode;
        }
        if (oldTop != top.stx_ino)
            if (Status set = store_.setRootInode(root, top.stx_ino); !set.ok())
                logError("Could not update a root: " + set.error().description());
        trees.push_back({root, top.stx_ino, oldTop});
    }
    if (trees.empty())
        return missing.ok() ? Result<std::vector<JournalEvent>>(std::vector<JournalEvent>{})
                            : Result<std::vector<JournalEvent>>(missing.error());
    return crawl(trees, journal);
}

Result<std::vector<JournalEvent>> JournalWriter::rescan(uint64_t inode) {
    auto path = store_.pathForInode(inode);
    if (!path.ok())
        return path.error();
    if (!path.value())
        return Error::posix(ENOENT);
    struct statx top {};
    if (!FileStamp::read(*path.value(), top))
        return Error::posix(errno);
    if (top.stx_ino != inode || !S_ISDIR(top.stx_mode))
        return Error::posix(ENOENT);  // another file took its place: the index catches up live
    return crawl({{*path.value(), inode, inode}}, true);
}

Result<std::vector<JournalEvent>> JournalWriter::crawl(const std::vector<Tree>& trees,
                                                       bool journal) {
    // The walk is done before the index is locked: it can take long.
    std::map<uint64_t, Found> onDisk;
    for (const Tree& tree : trees) walk(tree.path, tree.top, onDisk);
    // The crawl saw every file of every tree: a known file at a document's old path was moved
    // there, and one that moved from one tree to another is the same file.
    return commit(Settle::Clear, [&] { compareWithIndex(trees, onDisk, journal); });
}

void JournalWriter::walk(const std::string& at, uint64_t top, std::map<uint64_t, Found>& onDisk) {
    // What is on disk, walked relative to each directory's descriptor, never following links.
    FileSystem& fs = FileSystem::current();
    std::vector<std::pair<uint64_t, std::string>> stack{{top, at}};
    std::vector<FileSystem::DirectoryEntry> entries;
    while (!stack.empty()) {
        auto [dir, folder] = std::move(stack.back());
        stack.pop_back();
        ScopedFd fd(fs.open(folder, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (!fd.ok())
            continue;  // vanished or unreadable: what it held counts as gone
        entries.clear();
        bool listed = fs.readDirectory(fd.get(), entries);
        for (const auto& entry : listed ? entries : std::vector<FileSystem::DirectoryEntry>{}) {
            struct statx st {};
            if (fs.statx(fd.get(), entry.name, AT_SYMLINK_NOFOLLOW, FileStamp::kMask, &st) != 0)
                continue;
            InodeRecord record = FileStamp::recordOf(st, dir, entry.name);
            std::string path = folder + "/" + entry.name;
            if (record.kind == InodeRecord::kDirectory)
                stack.emplace_back(record.inode, path);
            onDisk[record.inode] = {std::move(record), std::move(path)};
        }
    }
}

void JournalWriter::compareWithIndex(const std::vector<Tree>& trees,
                                     std::map<uint64_t, Found>& onDisk, bool journal) {
    // What the index says, by inode.
    std::map<uint64_t, Found> indexed;
    std::vector<std::pair<uint64_t, std::string>> stack;
    for (const Tree& tree : trees)
        if (tree.oldTop != 0)
            stack.emplace_back(tree.oldTop, tree.path);
    while (!stack.empty()) {
        auto [dir, at] = std::move(stack.back());
        stack.pop_back();
        for (auto& child : orFail(store_.children(dir), std::vector<InodeRecord>())) {
            std::string path = at + "/" + child.name;
            if (child.kind == InodeRecord::kDirectory)
                stack.emplace_back(child.inode, path);
            indexed[child.inode] = {std::move(child), std::move(path)};
        }
    }

    std::vector<uint64_t> gone;
    std::vector<InodeRecord> updates;
    std::set<uint64_t> replaced;
    bool unstamped = false;
    for (auto& [inode, found] : indexed) {
        auto it = onDisk.find(inode);
        if (it != onDisk.end() && !FileStamp::sameFile(found.record, it->second.record)) {
            replaced.insert(inode);
            it = onDisk.end();
        }
        if (it == onDisk.end()) {
            gone.push_back(inode);
            if (found.record.docID != 0)
                vanish(found.record, found.path);
            if (journal)
                pending_.push_back({0, found.path, inode,
                                    kTremorItemRemoved | FileStamp::kindFlag(found.record.kind)});
            continue;
        }
        unstamped |= !found.record.stamped;
        const Found& now = it->second;
        uint32_t kind = FileStamp::kindFlag(now.record.kind);
        if (journal && now.path != found.path) {
            pending_.push_back({0, found.path, inode, kTremorItemRenamed | kind});
            pending_.push_back({0, now.path, inode, kTremorItemRenamed | kind});
        }
        if (journal && FileStamp::changedWhileAway(found.record, now.record))
            pending_.push_back({0, now.path, inode, kTremorItemModified | kind});
        if (FileStamp::differs(found.record, now.record))
            updates.push_back(now.record);
        // Attributes change only the change time; unknown after an upgrade, so read once then.
        if (found.record.docID != 0 && now.record.kind == InodeRecord::kFile &&
            (found.record.ctime == 0 || found.record.ctime != now.record.ctime))
            refreshAttributes(found.record.docID, now.path, inode);
    }
    // Removed first: a replaced inode comes back with its new self.
    fail(store_.removeInodes(gone), "Could not update the file index");
    for (auto& [inode, found] : onDisk) {
        if (indexed.contains(inode) && !replaced.contains(inode))
            continue;
        updates.push_back(found.record);
        if (journal)
            pending_.push_back({0, found.path, inode,
                                kTremorItemCreated | FileStamp::kindFlag(found.record.kind)});
        claimDocumentId(found.path, inode, found.record.kind);
    }
    fail(store_.upsertInodes(updates), "Could not update the file index");
    if (journal && unstamped) {
        // Indexed before contents were tracked: what changed inside files is not known.
        for (const Tree& tree : trees) {
            logInfo("Files in " + tree.path +
                    " may have changed unseen; asking readers to rescan it");
            pending_.push_back({0, tree.path, 0, kTremorUserDropped | kTremorMustScanSubdirs});
        }
    }
}

}  // namespace tamber
