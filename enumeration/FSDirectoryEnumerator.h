#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <vector>

#include "platform/OpenFolder.h"
#include "platform/Url.h"
#include "support/Error.h"

namespace tamber {

// The walk flags of a directory listing.
using DirectoryEnumerationOptions = uint32_t;
namespace DirectoryEnumerationOption {
inline constexpr DirectoryEnumerationOptions kSkipsSubdirectoryDescendants = 1;
inline constexpr DirectoryEnumerationOptions kSkipsPackageDescendants = 2;
inline constexpr DirectoryEnumerationOptions kSkipsHiddenFiles = 4;
}  // namespace DirectoryEnumerationOption

// One paged walk over some roots: skips `offset` entries (without reading anything of them
// beyond their directory entry), then delivers at most `limit`. Entries come in a stable order
// (by name, byte order, depth first), so that an offset means the same between calls.
struct FSDirectoryEnumerator {
    std::vector<Url> urls;
    bool recursively = false;
    uint64_t offset = 0;
    uint64_t limit = 0;
    // Called for entries that can't be read; true means go on. Nothing means
    // logEnumerationError.
    std::function<bool(const Url& url, const Error& error)> errorHandler;
    // A per-root override of the walk options; nothing means the default.
    std::function<std::optional<DirectoryEnumerationOptions>(const Url& root)>
        directoryEnumerationOptionsFor;

    // Walks and hands each delivered URL (its resource values for the item record prefetched)
    // to `deliver`; returns the counter: `offset` plus the entries delivered, or less when the
    // walk ran out before `offset`. Delivered URLs are made in their open folder (read relative
    // to it) while the walk runs; with `keepOpen`, those folders are added to it, so that the
    // caller can go on reading the URLs that way after the walk.
    uint64_t enumerate(const std::function<void(const Url& url)>& deliver,
                       std::vector<OpenFolderRef>* keepOpen = nullptr) const;

    // The usual error handler: "can't enumerate <path>; <error>", a debug line for a file that
    // vanished and an error line otherwise; always goes on.
    static bool logEnumerationError(const Url& url, const Error& error);
    // Skip hidden files and package contents; and subdirectories' contents unless recursive.
    static DirectoryEnumerationOptions defaultOptions(bool recursively);
};

}  // namespace tamber
