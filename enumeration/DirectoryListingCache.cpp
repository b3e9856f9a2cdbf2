#include "enumeration/DirectoryListingCache.h"
#include "support/MutexLock.h"

#include <algorithm>
#include <cerrno>

namespace tamber {

DirectoryListingCache& DirectoryListingCache::shared() {
    static DirectoryListingCache cache(kDefaultMaxListings, kDefaultMaxEntries);
    return cache;
}

DirectoryListingCache::DirectoryListingCache(size_t maxListings, size_t maxEntries)
    : maxListings_(maxListings), maxEntries_(maxEntries) {}

Result<DirectoryListingCache::Listing> DirectoryListingCache::listing(const std::string& path) {
    std::shared_ptr<FileSystem> fs = FileSystem::currentShared();
    int fd = fs->open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0)
        return directoryReadError(errno, path);

    Result<DirectoryStamp> stamp = DirectoryStamp::of(*fs, fd, path);
    if (!stamp.ok()) {
        fs->close(fd);
        return stamp.error();
    }
    if (Listing kept = find(fs.get(), *stamp)) {
        fs->close(fd);
        return kept;
    }

    auto entries = std::make_shared<Entries>();
    bool read = fs->readDirectory(fd, entries->all);
    int readError = errno;
    fs->close(fd);
    if (!read)
        return directoryReadError(readError, path);
    auto byName = [](const FileSystem::DirectoryEntry& a, const FileSystem::DirectoryEntry& b) {
        return a.name < b.name;
    };
    // Offsets count entries in this order; don't trust a file system to have kept it.
    if (!std::is_sorted(entries->all.begin(), entries->all.end(), byName))
        std::sort(entries->all.begin(), entries->all.end(), byName);
    entries->visible.reserve(entries->all.size());
    for (size_t i = 0; i < entries->all.size(); ++i) {
        if (!entries->all[i].name.starts_with('.'))
            entries->visible.push_back(static_cast<uint32_t>(i));
    }

    Listing listing = std::move(entries);
    // The stamp was taken before the read: a change made during the read shows as a newer
    // stamp next time, so the listing is never served for a directory it does not describe.
    if (stamp->oldEnoughToKeep())
        keep(fs, *stamp, listing);
    return listing;
}

DirectoryListingCache::Listing DirectoryListingCache::find(const FileSystem* fs,
                                                           const DirectoryStamp& stamp) {
    MutexLock lock(mutex_);
    for (auto it = kept_.begin(); it != kept_.end(); ++it) {
        if (it->fileSystem != fs || !it->stamp.sameDirectory(stamp))
            continue;
        if (it->stamp != stamp || it->fileSystemAlive.expired()) {
            keptEntries_ -= it->listing->all.size();
            kept_.erase(it);
            return nullptr;
        }
        kept_.splice(kept_.begin(), kept_, it);
        return kept_.front().listing;
    }
    return nullptr;
}

void DirectoryListingCache::keep(const std::shared_ptr<FileSystem>& fs, const DirectoryStamp& stamp,
                                 Listing listing) {
    if (maxListings_ == 0)
        return;
    MutexLock lock(mutex_);
    // Another thread may have read the same directory meanwhile.
    for (auto it = kept_.begin(); it != kept_.end(); ++it) {
        if (it->fileSystem == fs.get() && it->stamp.sameDirectory(stamp)) {
            keptEntries_ -= it->listing->all.size();
            kept_.erase(it);
            break;
        }
    }
    keptEntries_ += listing->all.size();
    kept_.push_front(Kept{fs.get(), fs, stamp, std::move(listing)});
    // The newest stays even when it alone is over the bound: it is the folder being listed, and
    // reading a folder of a million entries again for each of its pages would make every page
    // cost the whole folder.
    while (kept_.size() > 1 && (kept_.size() > maxListings_ || keptEntries_ > maxEntries_)) {
        keptEntries_ -= kept_.back().listing->all.size();
        kept_.pop_back();
    }
}

void DirectoryListingCache::clear() {
    MutexLock lock(mutex_);
    kept_.clear();
    keptEntries_ = 0;
}

size_t DirectoryListingCache::listingCount() const {
    MutexLock lock(mutex_);
    return kept_.size();
}

}  // namespace tamber
