#include "platform/tremors/JournalWriter.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <set>
#include <string_view>
#include <utility>

#include "platform/FileSystem.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr size_t kUpsertBatch = 1000;

bool statPath(const std::string& path, struct statx& st) {
    return FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_INO | STATX_TYPE,
                                       &st) == 0;
}

uint8_t kindOf(uint32_t mode) {
    if (S_ISREG(mode))
        return InodeRecord::kFile;
    if (S_ISDIR(mode))
        return InodeRecord::kDirectory;
    if (S_ISLNK(mode))
        return InodeRecord::kSymlink;
    return InodeRecord::kOther;
}

uint32_t kindFlag(uint8_t kind) {
    switch (kind) {
        case InodeRecord::kFile:
            return kTremorItemIsFile;
        case InodeRecord::kDirectory:
            return kTremorItemIsDir;
        case InodeRecord::kSymlink:
            return kTremorItemIsSymlink;
        default:
            return 0;
    }
}

std::string parentOf(const std::string& path) {
    size_t slash = path.rfind('/');
    return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

std::string nameOf(const std::string& path) {
    size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

void logIfFailed(const Status& status, std::string_view what) {
    if (status)
        logError(std::string(what) + ": " + status->description());
}

}  // namespace

std::string JournalWriter::documentIdPath(uint32_t device, uint32_t docID, uint64_t src,
                                          uint64_t dst) {
    return std::string(TremorStore::kDocumentIdRoot) + "/" + std::to_string(device) + "/changed/" +
           std::to_string(docID) + "/src=" + std::to_string(src) + ",dst=" + std::to_string(dst);
}

Result<std::vector<JournalEvent>> JournalWriter::apply(const std::vector<FileChange>& changes) {
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
    settleVanished();
    return commit();
}

Result<std::vector<JournalEvent>> JournalWriter::journalDropped(
    const std::vector<std::string>& paths, uint32_t flags) {
    for (const auto& path : paths) pending_.push_back({0, path, 0, flags});
    return commit();
}

Result<std::vector<JournalEvent>> JournalWriter::commit() {
    std::vector<JournalEvent> events = std::move(pending_);
    pending_.clear();
    if (events.empty())
        return events;
    auto last = store_.append(events);
    if (!last.ok())
        return last.error();
    return events;
}

std::optional<InodeRecord> JournalWriter::recordAt(const std::string& path) {
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
        return store_.inode(best->inode);
    std::string_view rest(path);
    rest.remove_prefix(best->path == "/" ? 1 : best->path.size() + 1);
    uint64_t parent = best->inode;
    std::optional<InodeRecord> found;
    while (!rest.empty()) {
        size_t slash = rest.find('/');
        std::string_view name = rest.substr(0, slash);
        rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash + 1);
        found.reset();
        for (auto& child : store_.children(parent)) {
            if (child.name == name) {
                found = std::move(child);
                break;
            }
        }
        if (!found)
            return std::nullopt;
        parent = found->inode;
    }
    return found;
}

void JournalWriter::forgetSubtree(const InodeRecord& top, const std::string& path) {
    std::vector<uint64_t> gone;
    std::vector<std::pair<InodeRecord, std::string>> stack{{top, path}};
    while (!stack.empty()) {
        auto [record, at] = std::move(stack.back());
        stack.pop_back();
        gone.push_back(record.inode);
        if (auto docID = store_.documentIdForInode(record.inode)) {
            record.docID = *docID;
            vanished_[at] = record;
        }
        if (record.kind == InodeRecord::kDirectory) {
            for (auto& child : store_.children(record.inode))
                stack.emplace_back(child, at + "/" + child.name);
        }
    }
    logIfFailed(store_.removeInodes(gone), "Could not update the file index");
}

void JournalWriter::claimDocumentId(const std::string& path, uint64_t inode) {
    auto it = vanished_.find(path);
    if (it == vanished_.end() || it->second.inode == inode)
        return;
    if (store_.documentIdForInode(inode))
        return;  // the new file is a document of its own
    uint32_t docID = it->second.docID;
    uint64_t old = it->second.inode;
    vanished_.erase(it);
    if (auto error = store_.moveDocumentId(docID, inode)) {
        logError("Could not move document ID " + std::to_string(docID) + ": " +
                 error->description());
        return;
    }
    pending_.push_back({0, documentIdPath(device_, docID, old, inode), inode,
                        kTremorItemRenamed | kTremorItemIsFile});
}

void JournalWriter::settleVanished() {
    for (auto& [path, record] : vanished_) {
        logIfFailed(store_.clearDocumentId(record.docID), "Could not clear a document ID");
        pending_.push_back({0, documentIdPath(device_, record.docID, record.inode, 0), record.inode,
                            kTremorItemRemoved | kTremorItemIsFile});
    }
    vanished_.clear();
}

void JournalWriter::created(const FileChange& change) {
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    struct statx st {};
    struct statx parent {};
    if (!statPath(change.path, st) || !statPath(parentOf(change.path), parent)) {
        // Gone already; its removal follows in this batch or the next.
        pending_.push_back({0, change.path, 0, kTremorItemCreated | kind});
        return;
    }
    if (auto existing = recordAt(change.path); existing && existing->inode != st.stx_ino)
        forgetSubtree(*existing, change.path);
    InodeRecord record{st.stx_ino, parent.stx_ino, nameOf(change.path), kindOf(st.stx_mode), 0};
    logIfFailed(store_.upsertInodes({record}), "Could not update the file index");
    pending_.push_back({0, change.path, st.stx_ino, kTremorItemCreated | kindFlag(record.kind)});
    claimDocumentId(change.path, st.stx_ino);
}

void JournalWriter::removed(const FileChange& change) {
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    auto record = recordAt(change.path);
    uint64_t inode = 0;
    if (record) {
        inode = record->inode;
        kind = kindFlag(record->kind);
        forgetSubtree(*record, change.path);
    }
    pending_.push_back({0, change.path, inode, kTremorItemRemoved | kind});
}

void JournalWriter::renamed(const FileChange& change) {
    auto from = recordAt(change.fromPath);
    struct statx st {};
    struct statx parent {};
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    uint64_t inode = from ? from->inode : 0;
    bool present = statPath(change.path, st) && statPath(parentOf(change.path), parent);
    if (present)
        inode = st.stx_ino;
    if (auto existing = recordAt(change.path); existing && existing->inode != inode)
        forgetSubtree(*existing, change.path);
    if (present) {
        InodeRecord record{inode, parent.stx_ino, nameOf(change.path), kindOf(st.stx_mode), 0};
        kind = kindFlag(record.kind);
        logIfFailed(store_.upsertInodes({record}), "Could not update the file index");
    }
    if (!change.fromPath.empty())
        pending_.push_back({0, change.fromPath, inode, kTremorItemRenamed | kind});
    pending_.push_back({0, change.path, inode, kTremorItemRenamed | kind});
    if (present)
        claimDocumentId(change.path, inode);
}

void JournalWriter::touched(const FileChange& change, uint32_t flag) {
    struct statx st {};
    uint64_t inode = 0;
    uint32_t kind = change.isDirectory ? kTremorItemIsDir : kTremorItemIsFile;
    if (statPath(change.path, st)) {
        inode = st.stx_ino;
        kind = kindFlag(kindOf(st.stx_mode));
    }
    pending_.push_back({0, change.path, inode, flag | kind});
}

Result<std::vector<JournalEvent>> JournalWriter::reconcile(const std::string& root, bool journal) {
    struct statx top {};
    if (!statPath(root, top))
        return Error::posix(errno);
    std::map<std::string, TremorStore::Root> rootsByPath;
    for (const auto& r : store_.roots()) rootsByPath[r.path] = r;
    auto known = rootsByPath.find(root);
    uint64_t oldTop = known == rootsByPath.end() ? 0 : known->second.inode;
    if (oldTop != top.stx_ino)
        logIfFailed(store_.setRootInode(root, top.stx_ino), "Could not update a root");

    // What the index says, by inode.
    std::map<uint64_t, Found> indexed;
    if (oldTop != 0) {
        std::vector<std::pair<uint64_t, std::string>> stack{{oldTop, root}};
        while (!stack.empty()) {
            auto [dir, at] = std::move(stack.back());
            stack.pop_back();
            for (auto& child : store_.children(dir)) {
                std::string path = at + "/" + child.name;
                if (child.kind == InodeRecord::kDirectory)
                    stack.emplace_back(child.inode, path);
                if (auto docID = store_.documentIdForInode(child.inode))
                    child.docID = *docID;
                indexed[child.inode] = {std::move(child), std::move(path)};
            }
        }
    }

    // What is on disk, walked relative to each directory's descriptor, never following links.
    FileSystem& fs = FileSystem::current();
    std::map<uint64_t, Found> onDisk;
    std::vector<InodeRecord> batch;
    std::vector<std::pair<uint64_t, std::string>> stack{{top.stx_ino, root}};
    std::vector<FileSystem::DirectoryEntry> entries;
    while (!stack.empty()) {
        auto [dir, at] = std::move(stack.back());
        stack.pop_back();
        int fd = fs.open(at, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
        if (fd < 0)
            continue;  // vanished or unreadable: what it held counts as gone
        entries.clear();
        bool listed = fs.readDirectory(fd, entries);
        for (const auto& entry : listed ? entries : std::vector<FileSystem::DirectoryEntry>{}) {
            struct statx st {};
            if (fs.statx(fd, entry.name, AT_SYMLINK_NOFOLLOW, STATX_INO | STATX_TYPE, &st) != 0)
                continue;
            InodeRecord record{st.stx_ino, dir, entry.name, kindOf(st.stx_mode), 0};
            std::string path = at + "/" + entry.name;
            if (record.kind == InodeRecord::kDirectory)
                stack.emplace_back(record.inode, path);
            batch.push_back(record);
            onDisk[record.inode] = {std::move(record), std::move(path)};
            if (batch.size() >= kUpsertBatch) {
                logIfFailed(store_.upsertInodes(batch), "Could not update the file index");
                batch.clear();
            }
        }
        fs.close(fd);
    }
    logIfFailed(store_.upsertInodes(batch), "Could not update the file index");

    std::vector<uint64_t> gone;
    std::set<uint64_t> replaced;
    for (auto& [inode, found] : indexed) {
        auto it = onDisk.find(inode);
        // A reused inode number of another kind is another file. (One of the same kind cannot
        // be told from a rename: the index keeps no generation or birth time.)
        if (it != onDisk.end() && it->second.record.kind != found.record.kind) {
            replaced.insert(inode);
            it = onDisk.end();
        }
        if (it == onDisk.end()) {
            gone.push_back(inode);
            if (found.record.docID != 0)
                vanished_[found.path] = found.record;
            if (journal)
                pending_.push_back(
                    {0, found.path, inode, kTremorItemRemoved | kindFlag(found.record.kind)});
        } else if (journal && it->second.path != found.path) {
            uint32_t flags = kTremorItemRenamed | kindFlag(it->second.record.kind);
            pending_.push_back({0, found.path, inode, flags});
            pending_.push_back({0, it->second.path, inode, flags});
        }
    }
    logIfFailed(store_.removeInodes(gone), "Could not update the file index");
    if (!replaced.empty()) {
        // removeInodes dropped them; their new selves are on disk.
        std::vector<InodeRecord> back;
        for (uint64_t inode : replaced) back.push_back(onDisk[inode].record);
        logIfFailed(store_.upsertInodes(back), "Could not update the file index");
    }
    for (auto& [inode, found] : onDisk) {
        if (indexed.count(inode) && !replaced.count(inode))
            continue;
        if (journal)
            pending_.push_back(
                {0, found.path, inode, kTremorItemCreated | kindFlag(found.record.kind)});
        claimDocumentId(found.path, inode);
    }
    settleVanished();
    return commit();
}

}  // namespace tamber
