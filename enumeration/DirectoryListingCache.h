#pragma once

#include <cstddef>
#include <cstdint>
#include <list>
#include <memory>
#include <string>
#include <vector>

#include "platform/DirectoryStamp.h"
#include "platform/FileSystem.h"
#include "platform/StampedDirectoryCache.h"
#include "support/Result.h"

namespace tamber {

// The sorted entries of recently listed directories, kept between the pages of a listing so
// that page N of a large folder does not read and sort the whole folder again. A kept listing
// is handed out only while the directory is provably unchanged: same file system object, same
// device and inode, same modification and change times, and those times old enough that a
// change within the same timestamp tick can't hide behind them. Bounded by a few listings and
// a total entry count, the least recently used going first; a listing larger than the bound is
// kept alone.
class DirectoryListingCache {
public:
    struct Entries {
        std::vector<FileSystem::DirectoryEntry> all;
        // Indices (into `all`) of the entries whose name does not begin with ".", so that a
        // walk that skips hidden entries can jump to an offset without looking at each one.
        std::vector<uint32_t> visible;
    };
    using Listing = std::shared_ptr<const Entries>;

    static constexpr size_t kDefaultMaxListings = 16;
    static constexpr size_t kDefaultMaxEntries = 400'000;

    // The process-wide cache.
    static DirectoryListingCache& shared();

    DirectoryListingCache(size_t maxListings, size_t maxEntries);
    DirectoryListingCache(const DirectoryListingCache&) = delete;
    DirectoryListingCache& operator=(const DirectoryListingCache&) = delete;

    // The entries of the directory at `path` (absolute), sorted by name in byte order, "." and
    // ".." left out. Never follows a final symbolic link. A missing directory is
    // HostPlatformErrorDomain 260; any other failure (ENOTDIR, ELOOP, EACCES...) its POSIX
    // error.
    Result<Listing> listing(const std::string& path);

    void clear();
    size_t listingCount() const;

    // How long after a directory's last change its listing may be kept.
    static constexpr int64_t kFineMarginNanoseconds = DirectoryStamp::kFineMarginNanoseconds;
    static constexpr int64_t kCoarseMarginNanoseconds = DirectoryStamp::kCoarseMarginNanoseconds;

private:
    // A folder over the bound of entries is still kept, alone: it is the folder being listed,
    // and reading a folder of a million entries again for each of its pages would make every
    // page cost the whole folder.
    StampedDirectoryCache<Listing> kept_;
};

}  // namespace tamber
