#pragma once

#include <string>

namespace tamber {

// One change seen in a watched tree, as the inotify side reports it to the journal.
struct FileChange {
    enum class Kind {
        Created,
        Removed,
        Modified,
        AttributesChanged,
        Renamed,
        // The kernel dropped events: history is lost and the watched trees need a rescan.
        Overflow,
        // `path` is a tree that is not (or no longer) watched; `error` says why.
        WatchFailed,
    };

    Kind kind = Kind::Modified;
    std::string path;      // absolute; for Renamed the new path; empty for Overflow
    std::string fromPath;  // Renamed only
    bool isDirectory = false;
    int error = 0;  // WatchFailed only: the errno value

    friend bool operator==(const FileChange&, const FileChange&) = default;

    static const char* kindName(Kind kind) {
        switch (kind) {
            case Kind::Created:
                return "Created";
            case Kind::Removed:
                return "Removed";
            case Kind::Modified:
                return "Modified";
            case Kind::AttributesChanged:
                return "AttributesChanged";
            case Kind::Renamed:
                return "Renamed";
            case Kind::Overflow:
                return "Overflow";
            case Kind::WatchFailed:
                return "WatchFailed";
        }
        return "?";
    }
};

}  // namespace tamber
