#pragma once

#include <memory>

#include "applibraries/LocalAppLibraryManager.h"
#include "enumeration/LocalFileEnumerator.h"
#include "host/HostPorterEnumerator.h"
#include "support/Mutex.h"

namespace tamber {

// The enumerator of the root and working-set containers: the app libraries (from a manager of
// its own) on the first page, then the files of the document storage and of every library,
// through a folder enumerator over their roots. Change enumeration carries the app-library
// version in the anchor and decides from it whether the host's view of the libraries is current,
// must be upgraded, or must be rebuilt.
class LocalRootEnumerator : public HostPorterEnumerator,
                            public std::enable_shared_from_this<LocalRootEnumerator> {
    struct Private {};

public:
    static std::shared_ptr<LocalRootEnumerator> initWithContainer(
        HostPorterItemIdentifier container);
    LocalRootEnumerator(Private, HostPorterItemIdentifier container);

    void enumerateItemsForObserver(std::shared_ptr<HostPorterEnumerationObserver> observer,
                                   const HostPorterPage& page) override;
    void enumerateChangesForObserver(std::shared_ptr<HostPorterChangeObserver> observer,
                                     const HostPorterSyncAnchor& anchor) override;
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<HostPorterSyncAnchor>)> completion) override;
    void invalidate() override;

    void start();
    void stop();

    const HostPorterItemIdentifier& container() const { return container_; }
    LocalFileEnumeratorRef localFileEnumerator() const;
    void setLocalFileEnumerator(LocalFileEnumeratorRef enumerator);
    bool isRunning() const;
    const std::shared_ptr<LocalAppLibraryManager>& appLibraryManager() const {
        return appLibraryManager_;
    }

private:
    bool isWorkingSet() const;
    // The libraries' roots, then the document storage.
    std::vector<Url> monitoredURLs() const;
    // Replaces the file enumerator by one over the current monitored URLs.
    void updateMonitoredURLs();
    // Brings the host's view of the libraries up to date, and the token's library version with
    // it; false when the enumeration ended (with an error) instead.
    bool updateAppLibraries(HostPorterChangeObserver& observer, FSChangeToken& token);
    void saveWorkingSetCache();
    std::string versionComparison(uint64_t tokenVersion, uint64_t localVersion,
                                  uint64_t mainCacheVersion) const;

    HostPorterItemIdentifier container_;
    std::shared_ptr<LocalAppLibraryManager> appLibraryManager_;
    mutable Mutex mutex_;
    LocalFileEnumeratorRef localFileEnumerator_ GUARDED_BY(mutex_);
    bool isRunning_ GUARDED_BY(mutex_) = false;
    std::shared_ptr<DispatchQueue> enumQueue_;
};

using LocalRootEnumeratorRef = std::shared_ptr<LocalRootEnumerator>;

}  // namespace tamber
