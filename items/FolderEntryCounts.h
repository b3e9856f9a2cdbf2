#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/DirectoryStamp.h"
#include "platform/FileSystem.h"
#include "platform/StampedDirectoryCache.h"

namespace tamber {

// The number of entries of large folders, kept while a folder is provably unchanged (see
// DirectoryStamp). A folder's record carries its entry count, and a browser asks for the
// folder's record with every page of its listing: counting a folder of 100,000 entries each time
// made every page cost the whole folder. Only folders of at least `minimumKept` entries are kept
// (a small one costs less to count than to keep), at most `capacity` of them, the least
// recently used going first.
class FolderEntryCounts {
public:
    static constexpr size_t kDefaultCapacity = 64;
    static constexpr uint64_t kDefaultMinimumKept = 1000;

    // The process-wide counts.
    static FolderEntryCounts& shared();

    FolderEntryCounts(size_t capacity, uint64_t minimumKept);
    FolderEntryCounts(const FolderEntryCounts&) = delete;
    FolderEntryCounts& operator=(const FolderEntryCounts&) = delete;

    // How many entries the folder at `path` has, hidden ones included ("." and ".." not), never
    // through a final symbolic link; nothing when it can't be read.
    std::optional<uint64_t> count(const std::string& path);

    void clear();
    size_t keptCount() const;

private:
    const uint64_t minimumKept_;
    StampedDirectoryCache<uint64_t> kept_;
};

}  // namespace tamber
