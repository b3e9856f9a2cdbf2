#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "applibraries/LocalAppLibraryCacheSource.h"
#include "host/HostPorterChangeObserver.h"
#include "host/HostPorterItemIdentifier.h"
#include "host/UrlOperations.h"
#include "platform/Url.h"
#include "platform/apps/BundleRecord.h"
#include "support/DispatchQueue.h"
#include "support/Result.h"

namespace tamber {

class LocalAppLibraryItem;
using LocalAppLibraryItemRef = std::shared_ptr<const LocalAppLibraryItem>;

// The current set of app libraries (the "Documents" folders of installed applications that
// publish documents), as items keyed by identifier and by root URL, with the version token of
// the cache content they came from. It refreshes the main cache from the app registry, upgrades
// itself from the main cache, and serves the lookups of the rest of the extension.
//
// Its content is touched only on its own serial queue. Refresh and upgrade run on the caller's
// thread and enter the main cache's queue before the manager's queue, never the reverse.
class LocalAppLibraryManager {
    struct Private {};

public:
    using AppLibrariesByItemIDs = std::map<HostPorterItemIdentifier, LocalAppLibraryItemRef>;
    using BundleProxiesByRootURLs = std::map<Url, BundleRecordRef>;

    // Loads what its cache holds on disk.
    static std::shared_ptr<LocalAppLibraryManager> init(LocalAppLibraryCacheSource cacheSource);
    // The process-wide manager (working-set cache), created on first use.
    static std::shared_ptr<LocalAppLibraryManager> shared();
    // Tests only: the next call of shared() creates a new manager.
    static void resetSharedForTesting();
    // The queue on which the provider runs the refresh of installed applications.
    static DispatchQueue& backgroundQueue();

    LocalAppLibraryManager(Private, LocalAppLibraryCacheSource cacheSource, bool isShared);
    LocalAppLibraryManager(const LocalAppLibraryManager&) = delete;
    LocalAppLibraryManager& operator=(const LocalAppLibraryManager&) = delete;

    LocalAppLibraryCacheSource cacheSource() const { return cacheSource_; }

    // Asks the app registry which applications publish documents; when the list differs from
    // the main cache's, writes it there with the next version token. True when it was written.
    // No manager changes until it is upgraded.
    bool refresh();
    // Takes the main cache's content when its token differs from the manager's, reporting the
    // libraries to `observer` (all current ones as updated, the vanished ones as deleted) and,
    // with `deleteIndex`, waiting until the host has dropped the index of the vanished ones.
    // True when the content changed. Must not run on a queue that the host's completion needs.
    bool upgradeFromMainCache(HostPorterChangeObserver* observer, bool deleteIndex);
    // Writes the current records and token to the manager's own cache, token unchanged.
    Status saveToCache();

    uint64_t versionToken() const;
    std::vector<LocalAppLibraryItemRef> allItems() const;
    LocalAppLibraryItemRef itemForIdentifier(const HostPorterItemIdentifier& identifier) const;
    AppLibrariesByItemIDs appLibrariesByItemIDs() const;

    // Hot reads, served from the content last published by the manager's queue: exactly what a
    // synchronous read would show, without the round trip.
    std::vector<Url> rootURLs() const;
    BundleProxiesByRootURLs bundleProxiesByRootURLs() const;
    // The record of the first library (in root URL order) whose root has `relationship` to
    // `url`, or null.
    BundleRecordRef bundleProxyFor(const Url& url, UrlRelationship relationship) const;

    // "<LocalAppLibraryManager:0x... [SHARED] versionToken:N cache-source:... app-libraries:N>"
    std::string description() const;

private:
    // Immutable once built: replaced as a whole, never changed in place.
    struct Content {
        uint64_t versionToken = 0;
        AppLibrariesByItemIDs appLibrariesByItemIDs;
        BundleProxiesByRootURLs bundleProxiesByRootURLs;
        std::vector<Url> rootURLs;  // the keys of bundleProxiesByRootURLs, for the hot reads
    };
    using ContentRef = std::shared_ptr<const Content>;

    enum class BuildContext { creation, upgrade };
    static ContentRef buildContent(uint64_t versionToken,
                                   const std::vector<BundleRecordRef>& records,
                                   BuildContext context);

    // On the queue: replaces the content and publishes it to the hot readers.
    void setContent(ContentRef content);
    ContentRef currentContent() const;    // a synchronous read on the queue
    ContentRef publishedContent() const;  // the snapshot, from any thread
    std::string describe(const Content& content) const;

    const LocalAppLibraryCacheSource cacheSource_;
    const std::shared_ptr<DispatchQueue> queue_;
    const bool isShared_;
    ContentRef content_;    // only on queue_
    ContentRef published_;  // std::atomic_load / std::atomic_store
};

}  // namespace tamber
