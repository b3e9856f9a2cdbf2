#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/tremors/SqliteDatabase.h"
#include "support/Result.h"

namespace tamber {

// The trees under watch, kept in the journal's database and mirrored in memory. Every event is
// filed under the ID of the root it belongs to, so that a folder-filtered replay reads an
// index on (root, id) instead of one on a random key. Roots are never deleted, only marked
// unwatched: their events stay in the journal and must stay findable.
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

    static const char* schema();
    // "/a/b" is at or below "/a"; "/ab" is not.
    static bool isAtOrBelow(std::string_view path, std::string_view base);
    // Without trailing slashes ("/" stays).
    static std::string normalised(std::string path);

    explicit WatchedRoots(SqliteDatabase& db) : db_(db) {}
    Status load();

    // See TremorStore::addRoot.
    Status add(const std::string& path, uint64_t sinceEventId, uint64_t inode);
    Status setInode(const std::string& path, uint64_t inode);
    Status remove(const std::string& path);
    std::vector<Root> watched() const;

    // The root an event at `path` is filed under: the longest watched one at or above it, or 0.
    uint64_t idFor(std::string_view path) const;
    // The roots, watched or not, under which events at or below one of `paths` may have been
    // filed (0 included). Empty when that is every root.
    std::vector<uint64_t> mayHoldEventsBelow(const std::vector<std::string>& paths) const;
    // Since when `path` has been watched without a gap, through any root at or above it.
    std::optional<uint64_t> watchedSince(const std::string& path) const;
    // The path of the watched root whose top is `inode`.
    const std::string* pathOfRootInode(uint64_t inode) const;

private:
    struct Row {
        Root root;
        bool watched = true;
    };
    Row* find(const std::string& path);
    Status write(const Row& row);

    SqliteDatabase& db_;
    std::vector<Row> rows_;
};

}  // namespace tamber
