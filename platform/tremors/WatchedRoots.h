#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

#include "platform/tremors/SqliteDatabase.h"
#include "support/Result.h"

namespace tamber {

// The trees under watch, kept in the journal's database and mirrored in memory. Every event is
// filed under the ID of the root it belongs to, so that a folder-filtered replay reads an
// index on (root, id) instead of one on a random key. Roots are never deleted, only marked
// unwatched or forgotten: their events stay in the journal and must stay findable.
//
// A root marked watched was watched without a gap until the last process that held the store
// stopped; it is live once this process watches it again. Only live roots answer paths: a
// tree that this run does not publish must not be reachable through its inodes.
//
// Not locked: TremorStore owns it and serialises every call.
class WatchedRoots {
public:
    struct Root {
        uint64_t id = 0;
        std::string path;
        uint64_t sinceEventId = 0;  // events after this one are complete for the tree
        uint64_t inode = 0;         // 0: not known (for example "/.docid")
    };

    // How a root is kept in the database (its "active" column).
    enum class State : int64_t { Unwatched = 0, Watched = 1, Forgotten = 2 };

    static const char* schema();
    // "/a/b" is at or below "/a"; "/ab" is not.
    static bool isAtOrBelow(std::string_view path, std::string_view base);
    // Without trailing slashes ("/" stays).
    static std::string normalised(std::string path);

    explicit WatchedRoots(SqliteDatabase& db) : db_(db) {}
    Status load();

    // See TremorStore for each of these.
    Status add(const std::string& path, uint64_t sinceEventId, uint64_t inode);
    Status setInode(const std::string& path, uint64_t inode);
    Status remove(const std::string& path);
    bool resume(const std::string& path);
    void release(const std::string& path);
    Result<std::vector<std::string>> retire();
    // Where the forgotten tree's index entries start (0: nowhere, or they are still another
    // remembered root's) and the tops of remembered roots inside it, whose entries stay.
    struct Forgotten {
        uint64_t top = 0;
        std::unordered_set<uint64_t> kept;
    };
    Result<Forgotten> forget(const std::string& path);
    std::vector<Root> watched() const;
    std::vector<Root> remembered() const;
    bool knows(const std::string& path) const;

    // The root an event at `path` is filed under: the longest watched one at or above it, or 0.
    uint64_t idFor(std::string_view path) const;
    // The roots, watched or not, under which events at or below one of `paths` may have been
    // filed (0 included). Empty when that is every root.
    std::vector<uint64_t> mayHoldEventsBelow(const std::vector<std::string>& paths) const;
    // Since when `path` has been watched without a gap, through any root at or above it.
    std::optional<uint64_t> watchedSince(const std::string& path) const;
    // The path of the live root whose top is `inode`.
    const std::string* pathOfRootInode(uint64_t inode) const;

private:
    struct Row {
        Root root;
        State state = State::Watched;
        bool live = false;  // watched by this process; never stored
        bool watched() const { return state == State::Watched; }
    };
    Row* find(const std::string& path);
    Status write(const Row& row);

    SqliteDatabase& db_;
    std::vector<Row> rows_;
};

}  // namespace tamber
