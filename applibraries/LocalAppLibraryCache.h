#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "applibraries/LocalAppLibraryCacheSource.h"
#include "platform/Url.h"
#include "platform/apps/BundleRecord.h"
#include "support/DispatchQueue.h"
#include "support/Result.h"

namespace tamber {

// One file on disk holding the list of app-library bundle records and a version token: a keyed
// archive whose root is {"versionToken": unsigned, "bundleProxy": [BundleRecord]}. It only
// stores and loads; the app-library manager decides what the records mean and when to save.
//
// Every operation runs on the cache's serial queue (callers use queue().sync); calling one from
// anywhere else stops the process.
class LocalAppLibraryCache {
    struct Private {};

public:
    struct Content {
        uint64_t versionToken = 0;
        std::vector<BundleRecordRef> bundleRecords;
    };

    // The process-wide instances, created on first use. The file lives in
    // "$XDG_DATA_HOME/Tamber" (default "$HOME/.local/share/Tamber"), read at creation.
    static std::shared_ptr<LocalAppLibraryCache> mainCache();
    static std::shared_ptr<LocalAppLibraryCache> workingSetCache();
    static std::shared_ptr<LocalAppLibraryCache> forSource(LocalAppLibraryCacheSource source);
    // Tests only: the next use creates fresh instances (reading the environment again).
    static void resetSharedForTesting();

    LocalAppLibraryCache(Private, LocalAppLibraryCacheSource source, Url cacheURL);
    LocalAppLibraryCache(const LocalAppLibraryCache&) = delete;
    LocalAppLibraryCache& operator=(const LocalAppLibraryCache&) = delete;

    LocalAppLibraryCacheSource source() const { return source_; }
    DispatchQueue& queue() const { return *queue_; }
    const Url& cacheURL() const { return cacheURL_; }

    // The highest token loaded or written so far.
    uint64_t versionToken() const;
    // Never fails: a missing, unreadable or malformed file gives (0, no records), and the
    // file is left as it is.
    Content load();
    // Writes the records with `versionToken`, or with the current token plus one when
    // `bumpVersion` is set; returns the token written. On failure nothing changes.
    Result<uint64_t> save(const std::vector<BundleRecordRef>& bundleRecords, uint64_t versionToken,
                          bool bumpVersion);
    // "~/" and the last four path components, for log lines.
    std::string abbreviatedPath(const Url& url) const;

private:
    LocalAppLibraryCacheSource source_;
    std::shared_ptr<DispatchQueue> queue_;
    Url cacheURL_;
    uint64_t versionToken_ = 0;  // only on queue_
};

}  // namespace tamber
