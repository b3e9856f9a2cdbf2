#include "platform/tremors/WatchedRoots.h"

#include <algorithm>
#include <cerrno>

#include "platform/tremors/TremorFlags.h"

namespace tamber {

namespace {

constexpr const char* kWatchedRootsSchema = R"sql(
CREATE TABLE roots(
    id INTEGER PRIMARY KEY,
    path TEXT NOT NULL UNIQUE,
    since_event_id INTEGER NOT NULL,
    inode INTEGER NOT NULL,
    active INTEGER NOT NULL);
)sql";

}  // namespace

const char* WatchedRoots::schema() {
    return kWatchedRootsSchema;
}

bool WatchedRoots::isAtOrBelow(std::string_view path, std::string_view base) {
    if (base == "/")
        return !path.empty() && path.front() == '/';
    if (path.size() < base.size() || path.compare(0, base.size(), base) != 0)
        return false;
    return path.size() == base.size() || path[base.size()] == '/';
}

std::string WatchedRoots::normalised(std::string path) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    return path;
}

Status WatchedRoots::load() {
    rows_.clear();
    auto stmt = db_.prepare("SELECT id, path, since_event_id, inode, active FROM roots");
    if (!stmt.ok())
        return stmt.error();
    Result<bool> r = stmt->step();
    for (; r.ok() && r.value(); r = stmt->step()) {
        Row row;
        row.root = {fromSqlite(stmt->columnInt64(0)), stmt->columnText(1),
                    fromSqlite(stmt->columnInt64(2)), fromSqlite(stmt->columnInt64(3))};
        int64_t state = stmt->columnInt64(4);
        row.state = state == int64_t(State::Watched)     ? State::Watched
                    : state == int64_t(State::Forgotten) ? State::Forgotten
                                                         : State::Unwatched;
        rows_.push_back(std::move(row));
    }
    if (!r.ok())
        return r.error();
    return Status::OK();
}

WatchedRoots::Row* WatchedRoots::find(const std::string& path) {
    auto it = std::find_if(rows_.begin(), rows_.end(),
                           [&](const Row& row) { return row.root.path == path; });
    return it == rows_.end() ? nullptr : &*it;
}

Status WatchedRoots::write(const Row& row) {
    auto stmt = db_.cached(
        "INSERT INTO roots(id, path, since_event_id, inode, active) VALUES(?, ?, ?, ?, ?) "
        "ON CONFLICT(id) DO UPDATE SET since_event_id = excluded.since_event_id, "
        "inode = excluded.inode, active = excluded.active");
    if (!stmt.ok())
        return stmt.error();
    return stmt->bind(1, toSqlite(row.root.id))
        .bind(2, row.root.path)
        .bind(3, toSqlite(row.root.sinceEventId))
        .bind(4, toSqlite(row.root.inode))
        .bind(5, static_cast<int64_t>(row.state))
        .run();
}

Status WatchedRoots::add(const std::string& rawPath, uint64_t sinceEventId, uint64_t inode) {
    std::string path = normalised(rawPath);
    if (path.empty() || path.front() != '/')
        return Error::invalidParameter("path", rawPath);
    Row* existing = find(path);
    Row updated;
    if (!existing) {
        // Root IDs are stored with events, so they are never reused either.
        uint64_t id = 1;
        for (const Row& row : rows_) id = std::max(id, row.root.id + 1);
        updated.root = {id, path, sinceEventId, inode};
    } else if (existing->watched()) {
        existing->live = true;
        if (inode == 0 || inode == existing->root.inode)
            return Status::OK();
        updated = *existing;
        updated.root.inode = inode;
    } else {
        // Watched again after a gap: its history starts anew.
        updated = *existing;
        updated.root.sinceEventId = sinceEventId;
        updated.root.inode = inode;
        updated.state = State::Watched;
    }
    updated.live = true;
    if (Status status = write(updated); !status.ok())
        return status;
    if (existing) {
        *existing = std::move(updated);
    } else {
        rows_.push_back(std::move(updated));
    }
    return Status::OK();
}

Status WatchedRoots::setInode(const std::string& path, uint64_t inode) {
    Row* row = find(normalised(path));
    if (!row || !row->watched())
        return Error::invalidParameter("root", path);
    Row updated = *row;
    updated.root.inode = inode;
    if (Status status = write(updated); !status.ok())
        return status;
    *row = std::move(updated);
    return Status::OK();
}

Status WatchedRoots::remove(const std::string& path) {
    Row* row = find(normalised(path));
    if (!row || !row->watched())
        return Status::OK();
    Row updated = *row;
    updated.state = State::Unwatched;
    updated.live = false;
    updated.root.inode = 0;
    if (Status status = write(updated); !status.ok())
        return status;
    *row = std::move(updated);
    return Status::OK();
}

bool WatchedRoots::resume(const std::string& path) {
    Row* row = find(normalised(path));
    if (!row || !row->watched())
        return false;
    row->live = true;
    return true;
}

void WatchedRoots::release(const std::string& path) {
    if (Row* row = find(normalised(path)))
        row->live = false;
}

Result<std::vector<std::string>> WatchedRoots::retire() {
    std::vector<std::string> retired;
    for (Row& row : rows_) {
        if (!row.watched() || row.live || row.root.path == kTremorDocumentIdRoot)
            continue;
        // The inode stays: a later forget still finds the tree's index entries from it.
        Row updated = row;
        updated.state = State::Unwatched;
        if (Status status = write(updated); !status.ok())
            return status.error();
        row = std::move(updated);
        retired.push_back(row.root.path);
    }
    return retired;
}

Result<WatchedRoots::Forgotten> WatchedRoots::forget(const std::string& path) {
    Row* row = find(normalised(path));
    if (!row || row->state == State::Forgotten)
        return Error(kPosixErrorDomain, ENOENT,
                     {{"description", path + " is not a remembered tree of the event journal"}});
    Row updated = *row;
    updated.state = State::Forgotten;
    updated.live = false;
    updated.root.inode = 0;
    if (Status status = write(updated); !status.ok())
        return status.error();
    Forgotten forgotten{row->root.inode, {}};
    *row = std::move(updated);
    for (const Row& other : rows_) {
        if (other.state == State::Forgotten || other.root.path == kTremorDocumentIdRoot)
            continue;
        if (isAtOrBelow(row->root.path, other.root.path))
            return Forgotten{};  // the tree is still that root's
        if (other.root.inode != 0 && isAtOrBelow(other.root.path, row->root.path))
            forgotten.kept.insert(other.root.inode);
    }
    return forgotten;
}

std::vector<WatchedRoots::Root> WatchedRoots::watched() const {
    std::vector<Root> result;
    for (const Row& row : rows_) {
        if (row.watched())
            result.push_back(row.root);
    }
    return result;
}

bool WatchedRoots::knows(const std::string& path) const {
    std::string wanted = normalised(path);
    return std::any_of(rows_.begin(), rows_.end(),
                       [&](const Row& row) { return row.root.path == wanted; });
}

std::vector<WatchedRoots::Root> WatchedRoots::remembered() const {
    std::vector<Root> result;
    for (const Row& row : rows_) {
        if (row.state != State::Forgotten)
            result.push_back(row.root);
    }
    return result;
}

uint64_t WatchedRoots::idFor(std::string_view path) const {
    const Row* best = nullptr;
    for (const Row& row : rows_) {
        if (row.watched() && isAtOrBelow(path, row.root.path) &&
            (!best || row.root.path.size() > best->root.path.size())) {
            best = &row;
        }
    }
    return best ? best->root.id : 0;
}

std::vector<uint64_t> WatchedRoots::mayHoldEventsBelow(
    const std::vector<std::string>& paths) const {
    // An event at or below P was filed under a root at or below P, under a root above P (before
    // a deeper root existed, or after it was unwatched), or under no root at all.
    std::vector<uint64_t> ids{0};
    for (const Row& row : rows_) {
        for (const std::string& path : paths) {
            if (isAtOrBelow(row.root.path, path) || isAtOrBelow(path, row.root.path)) {
                ids.push_back(row.root.id);
                break;
            }
        }
    }
    if (ids.size() == rows_.size() + 1)
        ids.clear();
    return ids;
}

std::optional<uint64_t> WatchedRoots::watchedSince(const std::string& path) const {
    std::optional<uint64_t> since;
    for (const Row& row : rows_) {
        if (row.watched() && isAtOrBelow(path, row.root.path)) {
            since = std::min(since.value_or(row.root.sinceEventId), row.root.sinceEventId);
        }
    }
    return since;
}

const std::string* WatchedRoots::pathOfRootInode(uint64_t inode) const {
    for (const Row& row : rows_) {
        if (row.watched() && row.live && row.root.inode == inode && inode != 0)
            return &row.root.path;
    }
    return nullptr;
}

}  // namespace tamber
