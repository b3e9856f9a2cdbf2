#include "enumeration/FSDirectoryEnumerator.h"

#include <dirent.h>

#include <cerrno>
#include <string>

#include "enumeration/DirectoryListingCache.h"
#include "items/LocalItem.h"
#include "platform/FileSystem.h"
#include "platform/TypeIdentifiers.h"
#include "support/Log.h"

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
};

// Walks one root depth first, counting and delivering through `pager`. An error handler that
// answers false ends the walk of this root.
void walkRoot(const Url& root, DirectoryEnumerationOptions options, Pager& pager) {
    if (!root.isFileURL()) {
        logError("can't create file enumerator at " + root.path());
        return;
    }
    const bool skipsHidden = options & Option::kSkipsHiddenFiles;
    const bool skipsPackages = options & Option::kSkipsPackageDescendants;
    const bool skipsSubdirectories = options & Option::kSkipsSubdirectoryDescendants;

    DirectoryListingCache& cache = DirectoryListingCache::shared();
    std::vector<Frame> stack;
    {
        Result<DirectoryListingCache::Listing> listing = cache.listing(root.path());
        if (!listing) {
            const Error& error = listing.error();
            if (error.is(kPosixErrorDomain, ENOTDIR) || error.is(kPosixErrorDomain, ELOOP)) {
                // A file or a link: there is no directory to walk.
                logError("can't create file enumerator at " + root.path());
            } else {
                (void)pager.handleError(root, error);
            }
            return;
        }
        stack.push_back(Frame{root.path(), std::move(*listing)});
    }

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
        std::string path = childPath(frame.path, entry.name);
        bool descend = !skipsSubdirectories && isDirectory(entry, path) &&
                       !(skipsPackages && IsPackageName(entry.name));

        if (pager.counter < pager.offset) {
            ++pager.counter;
        } else if (pager.counter - pager.offset < pager.limit) {
            ++pager.counter;
            Url url = Url::fileURLWithPath(path);
            if (Status prefetched = url.prefetchResourceValues(LocalItem::urlKeys())) {
                if (!pager.handleError(url, *prefetched))
                    return;
            } else {
                pager.deliver(url);
            }
        } else {
            // The entry that hits the limit is neither counted nor delivered.
            pager.keepGoing = false;
            return;
        }

        if (descend) {
            Result<DirectoryListingCache::Listing> listing = cache.listing(path);
            if (!listing) {
                if (!pager.handleError(Url::fileURLWithPath(path), listing.error()))
                    return;
                continue;
            }
            // `frame` may move: it is not used after this.
            stack.push_back(Frame{std::move(path), std::move(*listing)});
        }
    }
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

uint64_t FSDirectoryEnumerator::enumerate(
    const std::function<void(const Url& url)>& deliver) const {
    const ErrorHandler& handleError =
        errorHandler ? errorHandler : ErrorHandler(&FSDirectoryEnumerator::logEnumerationError);
    Pager pager{offset, limit, 0, limit != 0, deliver, handleError};
    for (const Url& root : urls) {
        if (!pager.keepGoing)
            break;
        std::optional<DirectoryEnumerationOptions> options;
        if (directoryEnumerationOptionsFor)
            options = directoryEnumerationOptionsFor(root);
        walkRoot(root, options.value_or(defaultOptions(recursively)), pager);
    }
    return pager.counter;
}

}  // namespace tamber
