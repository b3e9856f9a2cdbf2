#include "enumeration/DirectoryListingCache.h"
#include "support/MutexLock.h"

#include <algorithm>
#include <cerrno>
#include <chrono>

namespace tamber {

namespace {

Error listingError(int error, const std::string& path) {
    if (error == ENOENT)
        return Error::fileNoSuchFile(path);
    return Error::posix(error);
}

int64_t nanoseconds(int64_t seconds, uint32_t nanoseconds) {
    return seconds * 1'000'000'000 + nanoseconds;
}

}  // namespace

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
        return listingError(errno, path);

    Result<Stamp> stamp = stampOf(*fs, fd, path);
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
        return listingError(readError, path);
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
    if (oldEnoughToKeep(*stamp))
        keep(fs, *stamp, listing);
    return listing;
}

Result<DirectoryListingCache::Stamp> DirectoryListingCache::stampOf(FileSystem& fs, int fd,
                                                                    const std::string& path) {
    struct statx st {};
    if (fs.statx(fd, "", AT_EMPTY_PATH, STATX_INO | STATX_MTIME | STATX_CTIME, &st) != 0)
        return listingError(errno, path);
    Stamp stamp;
    stamp.deviceMajor = st.stx_dev_major;
    stamp.deviceMinor = st.stx_dev_minor;
    stamp.inode = st.stx_ino;
    stamp.mtimeSeconds = st.stx_mtime.tv_sec;
    stamp.mtimeNanoseconds = st.stx_mtime.tv_nsec;
    stamp.ctimeSeconds = st.stx_ctime.tv_sec;
    stamp.ctimeNanoseconds = st.stx_ctime.tv_nsec;
    return stamp;
}

bool DirectoryListingCache::oldEnoughToKeep(const Stamp& stamp) {
    // File times come from a clock that ticks every few milliseconds (every second or two on
    // some file systems): a change in the same tick as the read would leave the stamp as it
    // was. Keep only listings of directories that last changed well before the read.
    int64_t changed = std::max(nanoseconds(stamp.mtimeSeconds, stamp.mtimeNanoseconds),
                               nanoseconds(stamp.ctimeSeconds, stamp.ctimeNanoseconds));
    bool coarse = stamp.mtimeNanoseconds == 0 && stamp.ctimeNanoseconds == 0;
    int64_t margin = coarse ? kCoarseMarginNanoseconds : kFineMarginNanoseconds;
    int64_t now = std::chrono::duration_cast<std::chrono::nanoseconds>(
                      std::chrono::system_clock::now().time_since_epoch())
                      .count();
    return now - changed > margin;
}

DirectoryListingCache::Listing DirectoryListingCache::find(const FileSystem* fs,
                                                           const Stamp& stamp) {
    MutexLock lock(mutex_);
    for (auto it = kept_.begin(); it != kept_.end(); ++it) {
        if (it->fileSystem != fs || it->stamp.inode != stamp.inode ||
            it->stamp.deviceMajor != stamp.deviceMajor ||
            it->stamp.deviceMinor != stamp.deviceMinor) {
            continue;
        }
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

void DirectoryListingCache::keep(const std::shared_ptr<FileSystem>& fs, const Stamp& stamp,
                                 Listing listing) {
    if (maxListings_ == 0)
        return;
    MutexLock lock(mutex_);
    // Another thread may have read the same directory meanwhile.
    for (auto it = kept_.begin(); it != kept_.end(); ++it) {
        if (it->fileSystem == fs.get() && it->stamp.inode == stamp.inode &&
            it->stamp.deviceMajor == stamp.deviceMajor &&
            it->stamp.deviceMinor == stamp.deviceMinor) {
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
