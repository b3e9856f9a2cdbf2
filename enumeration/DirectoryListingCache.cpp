#include "enumeration/DirectoryListingCache.h"

#include <algorithm>
#include <cerrno>

namespace tamber {

DirectoryListingCache& DirectoryListingCache::shared() {
    static DirectoryListingCache cache(kDefaultMaxListings, kDefaultMaxEntries);
    return cache;
}

DirectoryListingCache::DirectoryListingCache(size_t maxListings, size_t maxEntries)
    : kept_(maxListings, maxEntries, [](const Listing& listing) { return listing->all.size(); }) {}

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
    if (std::optional<Listing> kept = kept_.find(fs.get(), *stamp)) {
        fs->close(fd);
        return *kept;
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
        kept_.keep(fs, *stamp, listing);
    return listing;
}

void DirectoryListingCache::clear() {
    kept_.clear();
}

size_t DirectoryListingCache::listingCount() const {
    return kept_.size();
}

}  // namespace tamber
