#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "host/HostPorterItemIdentifier.h"
#include "platform/Url.h"
#include "support/Error.h"

namespace tamber {

// The URL side of identifiers: maps a file URL to its identifier (resolving the file or document
// ID on disk) and an identifier back to a file URL (through the journal's inode index and
// document-ID service). Not to be confused with TBPFileObjectIdentifier, which only formats the
// strings. Nothing here throws: every failure is one log line and an empty result.
class TBFileObjectIdentifier {
public:
    // The 32-bit device number of the volume holding the item; 0 (and a POSIX error when asked
    // for) on failure.
    static uint32_t deviceIDWithError(const Url& url, Error* error);
    static uint32_t deviceID(const Url& url);
    // The volume of the document storage, 0 (logged) when it can't be read.
    static uint32_t storageDeviceID();

    // The identifier of the item at `url`. Caches the file or document ID it found in the URL's
    // resource values, so that a second call on the same URL is cheap.
    static std::optional<HostPorterItemIdentifier> itemIdentifier(const Url& url);

    // Gives every document among `urls` (regular files and packages inside the published
    // trees) its document ID in one go: one journal sync, one index read, and one transaction
    // for those that have none. Each ID is stored in its URL's resource-value cache (the
    // document-ID key; the file-ID key for folders), so that itemIdentifier(url) then
    // answers without touching the index. URLs that fail are left alone, for itemIdentifier
    // to find and log the failure as it does today.
    static void prepareItemIdentifiers(const std::vector<Url>& urls);

    static std::optional<Url> fileURLWithItemIdentifier(const HostPorterItemIdentifier& identifier);
    static std::optional<Url> fileURLWithFileIdentifier(uint64_t fileID);
    static std::optional<Url> _fileURLWithFileIdentifier(uint64_t fileID, uint32_t deviceID);

    // How often a document-ID resolution is retried after a passing failure, and the rest
    // between tries: at most about 5 ms on the caller's thread.
    static constexpr int kResolutionRetries = 5;
    static constexpr unsigned kRetryRestMicroseconds = 1000;
};

}  // namespace tamber
