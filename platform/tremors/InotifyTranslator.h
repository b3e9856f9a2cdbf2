#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/tremors/FileChange.h"

namespace tamber {

// Turns raw inotify event records into FileChanges with absolute paths. Keeps the table of
// watch descriptors and the directories they stand for, and follows renames of watched
// directories. Makes no system calls, so that it can be tested with synthetic buffers.
//
// Not thread-safe: one reader owns it.
class InotifyTranslator {
public:
    // Records that `wd` watches the directory `path` (absolute). Returns true when `wd` already
    // stood for exactly `path`, that is the directory was covered before; false when the watch
    // is new or had moved to `path`.
    bool addWatch(int wd, const std::string& path);
    void removeWatch(int wd);
    // The watched directory `from` and every watch below it now live under `to`.
    void renameWatches(const std::string& from, const std::string& to);

    size_t watchCount() const { return paths_.size(); }

    // Parses `length` bytes of inotify_event records and appends their changes to `out`, in the
    // order of the records. A buffer that ends inside a record or holds an impossible record is
    // translated up to that record, and an Overflow change marks the loss; returns false then.
    //
    // The two halves of a rename normally sit next to each other, but a read may end between
    // them: a move whose second half has not come yet is held back, together with every
    // change after it, until the next call. If the next call does not bring it either, the
    // move left the watched trees and is reported as Removed. An unmatched second half is a
    // move into the trees and is reported as Created.
    bool translate(const char* buffer, size_t length, std::vector<FileChange>& out);
    // Reports the held-back moves as Removed, with the changes after them.
    void flushPendingMoves(std::vector<FileChange>& out);
    bool hasPendingMoves() const { return !pending_.empty(); }

    // Watches forgotten because their directories left every watched tree. The kernel keeps
    // them until the caller removes them.
    std::vector<int> takeOrphanedWatches() { return std::exchange(orphaned_, {}); }

private:
    struct Record {
        int32_t wd;
        uint32_t mask;
        uint32_t cookie;
        std::string_view name;
    };
    struct PendingMove {
        uint32_t cookie;
        size_t index;  // of its placeholder change in the working list
        std::string path;
        bool isDirectory;
        bool carried;  // held over from an earlier call
    };

    // False when the record cannot come from the kernel.
    bool handle(const Record& record, std::vector<FileChange>& work, size_t firstNew);
    void handleSelfEvent(const Record& record, const std::string& dir,
                         std::vector<FileChange>& work);
    void resolveMovedOut(size_t pendingIndex);
    bool isRoot(const std::string& path) const;
    // The watch at `path` and every watch below it.
    std::vector<std::pair<std::string, int>> watchesUnder(const std::string& path) const;
    void forgetTree(const std::string& path, bool orphaned);

    std::unordered_map<int, std::string> paths_;
    std::map<std::string, int> watches_;  // ordered, so that a tree is one range
    std::vector<FileChange> held_;
    std::vector<PendingMove> pending_;
    std::vector<int> orphaned_;
    std::vector<std::string> unmounted_;  // reported in this call
};

}  // namespace tamber
