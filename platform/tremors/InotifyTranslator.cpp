#include "platform/tremors/InotifyTranslator.h"

#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>

#include "platform/UrlPath.h"

namespace tamber {

namespace {

using Kind = FileChange::Kind;

// The fixed part of a record: wd, mask, cookie, len; the name follows, NUL-padded to len.
constexpr size_t kHeaderSize = sizeof(struct inotify_event);
static_assert(kHeaderSize == 16);

std::string join(const std::string& dir, std::string_view name) {
    std::string path;
    path.reserve(dir.size() + 1 + name.size());
    path.append(dir);
    if (dir != "/")
        path.push_back('/');
    path.append(name);
    return path;
}

// The prefix every path strictly below `dir` starts with.
std::string below(const std::string& dir) {
    return dir == "/" ? dir : dir + "/";
}

std::optional<std::string> parentOf(const std::string& path) {
    size_t slash = path.rfind('/');
    if (slash == std::string::npos || path == "/")
        return std::nullopt;
    return slash == 0 ? std::string("/") : path.substr(0, slash);
}

FileChange change(Kind kind, std::string path, bool isDirectory, int error = 0) {
    FileChange c;
    c.kind = kind;
    c.path = std::move(path);
    c.isDirectory = isDirectory;
    c.error = error;
    return c;
}

}  // namespace

bool InotifyTranslator::addWatch(int wd, const std::string& path) {
    auto it = paths_.find(wd);
    if (it != paths_.end()) {
        if (it->second == path)
            return true;
        auto old = watches_.find(it->second);
        if (old != watches_.end() && old->second == wd)
            watches_.erase(old);
    }
    paths_[wd] = path;
    watches_[path] = wd;
    return false;
}

void InotifyTranslator::removeWatch(int wd) {
    auto it = paths_.find(wd);
    if (it == paths_.end())
        return;
    auto byPath = watches_.find(it->second);
    // The path may already belong to a newer watch (a directory replaced by another).
    if (byPath != watches_.end() && byPath->second == wd)
        watches_.erase(byPath);
    paths_.erase(it);
}

void InotifyTranslator::renameWatches(const std::string& from, const std::string& to) {
    auto moved = watchesUnder(from);
    for (const auto& [path, wd] : moved) watches_.erase(path);
    for (const auto& [path, wd] : moved) {
        std::string renamed = to + path.substr(from.size());
        paths_[wd] = renamed;
        watches_[renamed] = wd;
    }
}

bool InotifyTranslator::translate(const char* buffer, size_t length, std::vector<FileChange>& out) {
    std::vector<FileChange> work = std::move(held_);
    held_.clear();
    const size_t firstNew = work.size();
    for (auto& move : pending_) move.carried = true;

    bool wellFormed = true;
    size_t pos = 0;
    while (pos < length) {
        if (length - pos < kHeaderSize) {
            wellFormed = false;
            break;
        }
        Record record{};
        uint32_t nameLength;
        const char* header = buffer + pos;
        std::memcpy(&record.wd, header + offsetof(struct inotify_event, wd), sizeof record.wd);
        std::memcpy(&record.mask, header + offsetof(struct inotify_event, mask),
                    sizeof record.mask);
        std::memcpy(&record.cookie, header + offsetof(struct inotify_event, cookie),
                    sizeof record.cookie);
        std::memcpy(&nameLength, header + offsetof(struct inotify_event, len), sizeof nameLength);
        if (nameLength > length - pos - kHeaderSize) {
            wellFormed = false;
            break;
        }
        const char* name = header + kHeaderSize;
        record.name = std::string_view(name, strnlen(name, nameLength));
        if (!handle(record, work, firstNew)) {
            wellFormed = false;
            break;
        }
        pos += kHeaderSize + nameLength;
    }
    if (!wellFormed)
        work.push_back(change(Kind::Overflow, {}, false));

    // A carried move whose second half did not come in this read either left the trees.
    for (size_t i = 0; i < pending_.size();) {
        if (pending_[i].carried)
            resolveMovedOut(i);
        else
            ++i;
    }
    size_t cut = work.size();
    for (const auto& move : pending_) cut = std::min(cut, move.index);
    out.insert(out.end(), std::make_move_iterator(work.begin()),
               std::make_move_iterator(work.begin() + static_cast<ptrdiff_t>(cut)));
    held_.assign(std::make_move_iterator(work.begin() + static_cast<ptrdiff_t>(cut)),
                 std::make_move_iterator(work.end()));
    for (auto& move : pending_) move.index -= cut;
    unmounted_.clear();
    return wellFormed;
}

void InotifyTranslator::flushPendingMoves(std::vector<FileChange>& out) {
    while (!pending_.empty()) resolveMovedOut(0);
    out.insert(out.end(), std::make_move_iterator(held_.begin()),
               std::make_move_iterator(held_.end()));
    held_.clear();
}

bool InotifyTranslator::handle(const Record& record, std::vector<FileChange>& work,
                               size_t firstNew) {
    if (record.mask & IN_Q_OVERFLOW) {
        work.push_back(change(Kind::Overflow, {}, false));
        return true;
    }
    auto it = paths_.find(record.wd);
    // Events of a watch already removed can still be queued; they are of no interest.
    if (it == paths_.end())
        return true;
    const std::string dir = it->second;
    const bool isDirectory = (record.mask & IN_ISDIR) != 0;
    constexpr uint32_t kSelfEvents = IN_IGNORED | IN_UNMOUNT | IN_DELETE_SELF | IN_MOVE_SELF;
    if (record.mask & kSelfEvents) {
        handleSelfEvent(record, dir, work);
        return true;
    }

    constexpr uint32_t kChildEvents = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;
    if (record.mask & kChildEvents) {
        if (!UrlPath::isEntryName(record.name))
            return false;
        std::string path = join(dir, record.name);
        if (record.mask & IN_CREATE) {
            work.push_back(change(Kind::Created, std::move(path), isDirectory));
        } else if (record.mask & IN_DELETE) {
            work.push_back(change(Kind::Removed, std::move(path), isDirectory));
        } else if (record.mask & IN_MOVED_FROM) {
            // A placeholder that becomes the rename when the other half comes.
            pending_.push_back({record.cookie, work.size(), path, isDirectory, false});
            work.push_back(change(Kind::Removed, std::move(path), isDirectory));
        } else {
            auto from = std::find_if(pending_.begin(), pending_.end(), [&](const PendingMove& m) {
                return m.cookie == record.cookie;
            });
            if (from == pending_.end()) {
                work.push_back(change(Kind::Created, std::move(path), isDirectory));
            } else {
                FileChange& renamed = work[from->index];
                renamed.kind = Kind::Renamed;
                renamed.fromPath = from->path;
                renamed.path = path;
                renamed.isDirectory = isDirectory;
                if (isDirectory)
                    renameWatches(from->path, path);
                pending_.erase(from);
            }
        }
        return true;
    }

    // Changes to an entry, or to the watched directory itself when there is no name.
    if (!record.name.empty() && !UrlPath::isEntryName(record.name))
        return false;
    std::string path = record.name.empty() ? dir : join(dir, record.name);
    bool isSelf = record.name.empty();
    if (record.mask & (IN_MODIFY | IN_CLOSE_WRITE)) {
        // A save writes many times; one change per run of writes is enough.
        if (work.size() > firstNew && work.back().kind == Kind::Modified &&
            work.back().path == path && work.back().isDirectory == (isDirectory || isSelf))
            return true;
        work.push_back(change(Kind::Modified, std::move(path), isDirectory || isSelf));
    } else if (record.mask & IN_ATTRIB) {
        work.push_back(change(Kind::AttributesChanged, std::move(path), isDirectory || isSelf));
    }
    return true;
}

void InotifyTranslator::handleSelfEvent(const Record& record, const std::string& dir,
                                        std::vector<FileChange>& work) {
    if (record.mask & IN_MOVE_SELF) {
        // The kernel reports a rename's two halves before the moved directory's own event, so a
        // directory still waiting for its second half here was moved out of the trees.
        for (size_t i = 0; i < pending_.size(); ++i) {
            if (pending_[i].isDirectory && pending_[i].path == dir) {
                resolveMovedOut(i);
                return;
            }
        }
        // A root has no watched parent to report the move: the tree is gone from its path.
        if (isRoot(dir)) {
            work.push_back(change(Kind::Removed, dir, true));
            work.push_back(change(Kind::WatchFailed, dir, true, ENOENT));
            forgetTree(dir, true);
        }
        return;
    }
    if (record.mask & IN_UNMOUNT) {
        // Every watch of the file system gets this, in no particular order; one report per
        // unmounted tree is enough, a few more do no harm.
        bool covered = std::any_of(unmounted_.begin(), unmounted_.end(), [&](const auto& top) {
            return dir == top || dir.starts_with(below(top));
        });
        if (!covered) {
            work.push_back(change(Kind::WatchFailed, dir, true, ENODEV));
            unmounted_.push_back(dir);
        }
    } else if ((record.mask & IN_DELETE_SELF) && isRoot(dir)) {
        work.push_back(change(Kind::Removed, dir, true));
        work.push_back(change(Kind::WatchFailed, dir, true, ENOENT));
    }
    removeWatch(record.wd);
}

void InotifyTranslator::resolveMovedOut(size_t pendingIndex) {
    PendingMove move = std::move(pending_[pendingIndex]);
    pending_.erase(pending_.begin() + static_cast<ptrdiff_t>(pendingIndex));
    // Its placeholder already says Removed.
    if (move.isDirectory)
        forgetTree(move.path, true);
}

bool InotifyTranslator::isRoot(const std::string& path) const {
    auto parent = parentOf(path);
    return !parent || !watches_.contains(*parent);
}

std::vector<std::pair<std::string, int>> InotifyTranslator::watchesUnder(
    const std::string& path) const {
    std::vector<std::pair<std::string, int>> found;
    if (auto it = watches_.find(path); it != watches_.end())
        found.emplace_back(*it);
    const std::string prefix = below(path);
    for (auto it = watches_.lower_bound(prefix);
         it != watches_.end() && it->first.starts_with(prefix); ++it) {
        if (it->first != path)
            found.emplace_back(*it);
    }
    return found;
}

void InotifyTranslator::forgetTree(const std::string& path, bool orphaned) {
    for (const auto& [watchPath, wd] : watchesUnder(path)) {
        watches_.erase(watchPath);
        paths_.erase(wd);
        if (orphaned)
            orphaned_.push_back(wd);
    }
}

}  // namespace tamber
