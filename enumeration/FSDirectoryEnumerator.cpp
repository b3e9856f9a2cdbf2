#include "enumeration/FSDirectoryEnumerator.h"

#include <dirent.h>

#include <cerrno>
#include <list>
#include <optional>
#include <string>

#include "enumeration/DirectoryListingCache.h"
#include "host/PublishedTrees.h"
#include "items/LocalItem.h"
#include "platform/FileSystem.h"
#include "platform/TypeIdentifiers.h"
#include "support/Log.h"
#include "support/MutexLock.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

namespace Option = DirectoryEnumerationOption;
using ErrorHandler = std::function<bool(const Url& url, const Error& error)>;

std::string childPath(const std::string& parent, const std::string& name) {
    std::string path;
    path.reserve(parent.size() + 1 + name.size());
    path.append(parent);
    if (!path.ends_with('/'))
        path.push_back('/');
    path.append(name);
    return path;
}

// Whether the entry is a directory, from its directory entry alone unless the file system left
// the type out.
bool isDirectory(const FileSystem::DirectoryEntry& entry, const std::string& path) {
    if (entry.type != DT_UNKNOWN)
        return entry.type == DT_DIR;
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) != 0)
        return false;  // gone: the delivery (or nothing) will say so
    return S_ISDIR(st.stx_mode);
}

// One directory being walked: its listing and the position in it. Positions run over the
// visible entries when hidden ones are skipped, else over all.
struct Frame {
    std::string path;
    DirectoryListingCache::Listing listing;
    size_t position = 0;
    // Opened when the walk first delivers one of its entries; never kept in a cursor.
    OpenFolderRef folder{};
    bool opened = false;

    // The open folder, or null when it can't be opened (its entries are then read by path).
    const OpenFolderRef& openFolder(std::vector<OpenFolderRef>* keepOpen) {
        if (!opened) {
            opened = true;
            folder = PublishedTrees::openListedFolder(path);
            if (folder && keepOpen)
                keepOpen->push_back(folder);
        }
        return folder;
    }

    size_t size(bool skipsHidden) const {
        return skipsHidden ? listing->visible.size() : listing->all.size();
    }
    const FileSystem::DirectoryEntry& at(size_t i, bool skipsHidden) const {
        return skipsHidden ? listing->all[listing->visible[i]] : listing->all[i];
    }
};

// The paging state shared by every root of one enumeration.
struct Pager {
    uint64_t offset;
    uint64_t limit;
    uint64_t counter = 0;
    bool keepGoing;
    const std::function<void(const Url&)>& deliver;
    const ErrorHandler& handleError;
    std::vector<OpenFolderRef>* keepOpen;
};

// The listing of a root to start its walk with; nothing (after logging or handing the error
// on) when it can't be walked.
std::optional<std::vector<Frame>> openRoot(const Url& root, Pager& pager) {
    if (!root.isFileURL()) {
        logError("can't create file enumerator at " + root.path());
        return std::nullopt;
    }
    Result<DirectoryListingCache::Listing> listing =
        DirectoryListingCache::shared().listing(root.path());
    if (!listing.ok()) {
        const Error& error = listing.error();
        if (error.is(kPosixErrorDomain, ENOTDIR) || error.is(kPosixErrorDomain, ELOOP)) {
            // A file or a link: there is no directory to walk.
            logError("can't create file enumerator at " + root.path());
        } else {
            (void)pager.handleError(root, error);
        }
        return std::nullopt;
    }
    std::vector<Frame> stack;
    stack.push_back(Frame{root.path(), std::move(*listing), 0, nullptr, false});
    return stack;
}

// Walks a root depth first from `stack`, counting and delivering through `pager`. An error
// handler that answers false ends the walk of this root. When the page fills, `stack` is left
// pointing at the first entry not delivered, so that the next page can go on from there.
void walkFrames(std::vector<Frame>& stack, DirectoryEnumerationOptions options, Pager& pager) {
    const bool skipsHidden = options & Option::kSkipsHiddenFiles;
    const bool skipsPackages = options & Option::kSkipsPackageDescendants;
    const bool skipsSubdirectories = options & Option::kSkipsSubdirectoryDescendants;
    DirectoryListingCache& cache = DirectoryListingCache::shared();

    while (!stack.empty() && pager.keepGoing) {
        Frame& frame = stack.back();
        const size_t size = frame.size(skipsHidden);
        if (frame.position >= size) {
            stack.pop_back();
            continue;
        }
        // Skipping inside a directory that won't be descended from costs nothing per entry.
        if (skipsSubdirectories && pager.counter < pager.offset) {
            uint64_t skip = std::min<uint64_t>(pager.offset - pager.counter, size - frame.position);
            frame.position += skip;
            pager.counter += skip;
            continue;
        }
        const FileSystem::DirectoryEntry& entry = frame.at(frame.position++, skipsHidden);
        if (!skipsHidden && (entry.name == "." || entry.name == ".."))
            continue;
        if (pager.counter >= pager.offset && pager.counter - pager.offset >= pager.limit) {
            // The entry that hits the limit is neither counted nor delivered: the next page
            // starts with it.
            --frame.position;
            pager.keepGoing = false;
            return;
        }
        std::string path = childPath(frame.path, entry.name);
        bool descend = !skipsSubdirectories && isDirectory(entry, path) &&
                       !(skipsPackages && IsPackageName(entry.name));

        ++pager.counter;
        if (pager.counter > pager.offset) {
            const OpenFolderRef& folder = frame.openFolder(pager.keepOpen);
            Url url =
                folder ? Url::fileURLInFolder(folder, entry.name) : Url::fileURLWithPath(path);
            if (Status prefetched = url.prefetchResourceValues(LocalItem::listingKeys());
                !prefetched.ok()) {
                if (!pager.handleError(url, prefetched.error()))
                    return;
            } else {
                pager.deliver(url);
            }
        }

        if (descend) {
            Result<DirectoryListingCache::Listing> listing = cache.listing(path);
            if (!listing.ok()) {
                if (!pager.handleError(Url::fileURLWithPath(path), listing.error()))
                    return;
                continue;
            }
            // `frame` may move: it is not used after this.
            stack.push_back(Frame{std::move(path), std::move(*listing), 0, nullptr, false});
        }
    }
}

// Where walks that filled their page stopped, so that the next page of a tree resumes there
// instead of walking again over everything before its offset (which made listing a tree of
// 100,000 files page by page quadratic). A stopped walk is found again by its roots, options
// and counter, and used only while every folder on its path still holds what it held.
struct Cursor {
    std::string key;
    size_t rootIndex = 0;
    std::vector<Frame> stack;
    uint64_t counter = 0;
};

class CursorCache {
public:
    static CursorCache& shared() {
        static ProcessWide<CursorCache> cache;  // used from walks until the process ends
        return *cache;
    }

    void keep(Cursor cursor) {
        MutexLock lock(mutex_);
        cursors_.push_front(std::move(cursor));
        if (cursors_.size() > kMaxCursors)
            cursors_.pop_back();
    }

    std::optional<Cursor> take(const std::string& key, uint64_t counter) {
        MutexLock lock(mutex_);
        for (auto it = cursors_.begin(); it != cursors_.end(); ++it) {
            if (it->key == key && it->counter == counter) {
                Cursor cursor = std::move(*it);
                cursors_.erase(it);
                return cursor;
            }
        }
        return std::nullopt;
    }

private:
    static constexpr size_t kMaxCursors = 8;
    Mutex mutex_;
    std::list<Cursor> cursors_ GUARDED_BY(mutex_);
};

bool sameEntries(const DirectoryListingCache::Entries& a, const DirectoryListingCache::Entries& b) {
    if (a.all.size() != b.all.size())
        return false;
    for (size_t i = 0; i < a.all.size(); ++i) {
        if (a.all[i].name != b.all[i].name || a.all[i].inode != b.all[i].inode)
            return false;
    }
    return true;
}

// Whether every folder on the cursor's path lists as it did when the walk stopped.
bool stillValid(Cursor& cursor) {
    for (Frame& frame : cursor.stack) {
        Result<DirectoryListingCache::Listing> now =
            DirectoryListingCache::shared().listing(frame.path);
        if (!now.ok() || !(*now == frame.listing || sameEntries(**now, *frame.listing)))
            return false;
    }
    return true;
}

}  // namespace

bool FSDirectoryEnumerator::logEnumerationError(const Url& url, const Error& error) {
    std::string message = "can't enumerate " + url.path() + "; " + error.description();
    if (error.is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile))
        logDebug(message);
    else
        logError(message);
    return true;
}

DirectoryEnumerationOptions FSDirectoryEnumerator::defaultOptions(bool recursively) {
    DirectoryEnumerationOptions options =
        Option::kSkipsHiddenFiles | Option::kSkipsPackageDescendants;
    if (!recursively)
        options |= Option::kSkipsSubdirectoryDescendants;
    return options;
}

uint64_t FSDirectoryEnumerator::enumerate(const std::function<void(const Url& url)>& deliver,
                                          std::vector<OpenFolderRef>* keepOpen) const {
    const ErrorHandler& handleError =
        errorHandler ? errorHandler : ErrorHandler(&FSDirectoryEnumerator::logEnumerationError);
    Pager pager{offset, limit, 0, limit != 0, deliver, handleError, keepOpen};

    std::vector<DirectoryEnumerationOptions> options;
    std::string key;
    for (const Url& root : urls) {
        std::optional<DirectoryEnumerationOptions> override;
        if (directoryEnumerationOptionsFor)
            override = directoryEnumerationOptionsFor(root);
        options.push_back(override.value_or(defaultOptions(recursively)));
        key += root.path() + '\0' + std::to_string(options.back()) + '\0';
    }

    size_t first = 0;
    std::optional<Cursor> cursor;
    if (offset > 0 && pager.keepGoing) {
        cursor = CursorCache::shared().take(key, offset);
        if (cursor && stillValid(*cursor)) {
            first = cursor->rootIndex;
            pager.counter = offset;
        } else {
            cursor.reset();
        }
    }
    for (size_t i = first; i < urls.size() && pager.keepGoing; ++i) {
        std::optional<std::vector<Frame>> stack;
        if (cursor && i == first)
            stack = std::move(cursor->stack);
        else
            stack = openRoot(urls[i], pager);
        if (!stack)
            continue;
        walkFrames(*stack, options[i], pager);
        if (!pager.keepGoing) {
            // A cursor keeps no descriptors: the next page opens what it reads.
            for (Frame& frame : *stack) {
                frame.folder.reset();
                frame.opened = false;
            }
            CursorCache::shared().keep(Cursor{key, i, std::move(*stack), pager.counter});
        }
    }
    return pager.counter;
}

}  // namespace tamber
