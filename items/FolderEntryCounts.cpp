#include "items/FolderEntryCounts.h"

#include <fcntl.h>

#include <vector>

#include "platform/ScopedFd.h"
#include "support/ProcessWide.h"

namespace tamber {

FolderEntryCounts& FolderEntryCounts::shared() {
    static ProcessWide<FolderEntryCounts> counts(kDefaultCapacity, kDefaultMinimumKept);
    return *counts;
}

FolderEntryCounts::FolderEntryCounts(size_t capacity, uint64_t minimumKept)
    : minimumKept_(minimumKept),
      kept_(capacity, capacity, [](const uint64_t&) -> size_t { return 1; }) {}

std::optional<uint64_t> FolderEntryCounts::count(const std::string& path) {
    std::shared_ptr<FileSystem> fs = FileSystem::currentShared();
    ScopedFd fd(fs->open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, 0));
    if (!fd.ok())
        return std::nullopt;
    Result<DirectoryStamp> stamp = DirectoryStamp::of(*fs, fd.get(), path);
    if (!stamp.ok())
        return std::nullopt;
    if (std::optional<uint64_t> kept = kept_.find(fs.get(), *stamp))
        return kept;
    std::vector<FileSystem::DirectoryEntry> entries;
    if (!fs->readDirectory(fd.get(), entries))
        return std::nullopt;
    // The stamp was taken before the read: a change made during it shows as a newer stamp.
    if (entries.size() >= minimumKept_ && stamp->oldEnoughToKeep())
        kept_.keep(fs, *stamp, entries.size());
    return entries.size();
}

void FolderEntryCounts::clear() {
    kept_.clear();
}

size_t FolderEntryCounts::keptCount() const {
    return kept_.size();
}

}  // namespace tamber
