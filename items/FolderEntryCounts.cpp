#include "items/FolderEntryCounts.h"

#include <fcntl.h>

#include <vector>

#include "platform/ScopedFd.h"
#include "support/MutexLock.h"
#include "support/ProcessWide.h"

namespace tamber {

FolderEntryCounts& FolderEntryCounts::shared() {
    static ProcessWide<FolderEntryCounts> counts(kDefaultCapacity, kDefaultMinimumKept);
    return *counts;
}

FolderEntryCounts::FolderEntryCounts(size_t capacity, uint64_t minimumKept)
    : capacity_(capacity), minimumKept_(minimumKept) {}

std::optional<uint64_t> FolderEntryCounts::count(const std::string& path) {
    std::shared_ptr<FileSystem> fs = FileSystem::currentShared();
    ScopedFd fd(fs->open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, 0));
    if (!fd.ok())
        return std::nullopt;
    Result<DirectoryStamp> stamp = DirectoryStamp::of(*fs, fd.get(), path);
    if (!stamp.ok())
        return std::nullopt;
    if (std::optional<uint64_t> kept = find(fs.get(), *stamp))
        return kept;
    std::vector<FileSystem::DirectoryEntry> entries;
    if (!fs->readDirectory(fd.get(), entries))
        return std::nullopt;
    // The stamp was taken before the read: a change made during it shows as a newer stamp.
    if (entries.size() >= minimumKept_ && stamp->oldEnoughToKeep())
        keep(fs, *stamp, entries.size());
    return entries.size();
}

std::optional<uint64_t> FolderEntryCounts::find(const FileSystem* fs, const DirectoryStamp& stamp) {
    MutexLock lock(mutex_);
    for (auto it = kept_.begin(); it != kept_.end(); ++it) {
        if (it->fileSystem != fs || !it->stamp.sameDirectory(stamp))
            continue;
        if (it->stamp != stamp || it->fileSystemAlive.expired()) {
            kept_.erase(it);
            return std::nullopt;
        }
        kept_.splice(kept_.begin(), kept_, it);
        return kept_.front().count;
    }
    return std::nullopt;
}

void FolderEntryCounts::keep(const std::shared_ptr<FileSystem>& fs, const DirectoryStamp& stamp,
                             uint64_t count) {
    if (capacity_ == 0)
        return;
    MutexLock lock(mutex_);
    std::erase_if(kept_, [&](const Kept& kept) {
        return kept.fileSystem == fs.get() && kept.stamp.sameDirectory(stamp);
    });
    kept_.push_front(Kept{fs.get(), fs, stamp, count});
    while (kept_.size() > capacity_) kept_.pop_back();
}

void FolderEntryCounts::clear() {
    MutexLock lock(mutex_);
    kept_.clear();
}

size_t FolderEntryCounts::keptCount() const {
    MutexLock lock(mutex_);
    return kept_.size();
}

}  // namespace tamber
