#include "enumeration/LocalRootEnumerator.h"

#include "applibraries/LocalAppLibraryCache.h"
#include "host/HostPorterManager.h"
#include "items/LocalAppLibraryItem.h"
#include "support/Log.h"
#include "support/LogSection.h"
#include "support/MutexLock.h"

namespace tamber {

namespace {

std::string describeRootPaths(const std::vector<Url>& urls) {
    std::string text = "[";
    for (size_t i = 0; i < urls.size(); ++i) {
        if (i > 0)
            text += ", ";
        text += urls[i].path();
    }
    return text + "]";
}

std::vector<HostPorterItemRef> hostItems(const std::vector<LocalAppLibraryItemRef>& libraries) {
    return std::vector<HostPorterItemRef>(libraries.begin(), libraries.end());
}

}  // namespace

std::shared_ptr<LocalRootEnumerator> LocalRootEnumerator::initWithContainer(
    HostPorterItemIdentifier container) {
    return std::make_shared<LocalRootEnumerator>(Private{}, std::move(container));
}

LocalRootEnumerator::LocalRootEnumerator(Private, HostPorterItemIdentifier container)
    : container_(std::move(container)),
      enumQueue_(DispatchQueue::makeSerial("tamber.root-enumerator.queue")) {
    appLibraryManager_ = LocalAppLibraryManager::init(
        isWorkingSet() ? LocalAppLibraryCacheSource::workingSet : LocalAppLibraryCacheSource::main);
    localFileEnumerator_ = LocalFileEnumerator::initWithContainer(container_, monitoredURLs());
}

bool LocalRootEnumerator::isWorkingSet() const {
    return container_ == HostPorterWorkingSetContainerItemIdentifier;
}

std::vector<Url> LocalRootEnumerator::monitoredURLs() const {
    std::vector<Url> urls = appLibraryManager_->rootURLs();
    urls.push_back(HostPorterManager::defaultManager()->documentStorageURL());
    return urls;
}

LocalFileEnumeratorRef LocalRootEnumerator::localFileEnumerator() const {
    MutexLock lock(mutex_);
    return localFileEnumerator_;
}

void LocalRootEnumerator::setLocalFileEnumerator(LocalFileEnumeratorRef enumerator) {
    MutexLock lock(mutex_);
    localFileEnumerator_ = std::move(enumerator);
}

bool LocalRootEnumerator::isRunning() const {
    MutexLock lock(mutex_);
    return isRunning_;
}

void LocalRootEnumerator::start() {
    // On the queue, so that a start never interleaves with a replacement of the enumerator.
    enumQueue_->sync([&] {
        LocalFileEnumeratorRef enumerator;
        {
            MutexLock lock(mutex_);
            if (isRunning_)
                return;
            isRunning_ = true;
            enumerator = localFileEnumerator_;
        }
        enumerator->start();
    });
}

void LocalRootEnumerator::stop() {
    enumQueue_->sync([&] {
        LocalFileEnumeratorRef enumerator;
        {
            MutexLock lock(mutex_);
            if (!isRunning_)
                return;
            isRunning_ = false;
            enumerator = localFileEnumerator_;
        }
        enumerator->invalidate();
    });
}

void LocalRootEnumerator::invalidate() {
    stop();
}

void LocalRootEnumerator::updateMonitoredURLs() {
    enumQueue_->sync([&] {
        bool running = isRunning();
        if (running)
            localFileEnumerator()->invalidate();
        std::vector<Url> urls = monitoredURLs();
        LocalFileEnumeratorRef enumerator =
            LocalFileEnumerator::initWithContainer(container_, urls);
        setLocalFileEnumerator(enumerator);
        logDebug([&] { return "updated root enumerator to monitor " + describeRootPaths(urls); });
        if (running)
            enumerator->start();
    });
}

std::string LocalRootEnumerator::versionComparison(uint64_t tokenVersion, uint64_t localVersion,
                                                   uint64_t mainCacheVersion) const {
    std::string text = "[changeTokenVersion: " + std::to_string(tokenVersion) + ", " +
                       "localVersion: " + std::to_string(localVersion) + ", ";
    if (isWorkingSet()) {
        text += "workingSetVersion: " +
                std::to_string(LocalAppLibraryManager::shared()->versionToken()) + ", ";
    }
    return text + "mainCacheVersion: " + std::to_string(mainCacheVersion) + "]";
}

void LocalRootEnumerator::enumerateItemsForObserver(
    std::shared_ptr<HostPorterEnumerationObserver> observer, const HostPorterPage& page) {
    withLogSection("enumerate root items for " + container_, [&] {
        if (isHostPorterInitialPage(page)) {
            std::vector<HostPorterItemRef> libraries;
            for (const auto& [identifier, item] : appLibraryManager_->appLibrariesByItemIDs())
                libraries.push_back(item);
            observer->didEnumerateItems(libraries);
            logDebug([&] {
                return "discovered " + std::to_string(libraries.size()) + " app-libraries";
            });
        }
        localFileEnumerator()->enumerateItemsForObserver(observer, page);
    });
}

void LocalRootEnumerator::enumerateChangesForObserver(
    std::shared_ptr<HostPorterChangeObserver> observer, const HostPorterSyncAnchor& anchor) {
    withLogSection("enumerate root changes for " + container_, [&] {
        std::optional<FSChangeToken> token = FSChangeToken::decode(anchor);
        if (!token) {
            logError("can't create change token from anchor data, resetting");
            observer->finishEnumeratingWithError(Error::syncAnchorExpired());
            return;
        }
        if (!updateAppLibraries(*observer, *token))
            return;
        localFileEnumerator()->enumerateChangesForObserver(observer, *token);
    });
}

bool LocalRootEnumerator::updateAppLibraries(HostPorterChangeObserver& observer,
                                             FSChangeToken& token) {
    const uint64_t tokenVersion = token.appLibraryVersionToken;
    logDebug([&] { return "notifying app library changes since " + std::to_string(tokenVersion); });
    const uint64_t localVersion = appLibraryManager_->versionToken();
    auto mainCache = LocalAppLibraryCache::mainCache();
    const uint64_t mainCacheVersion =
        mainCache->queue().sync([&] { return mainCache->versionToken(); });

    if (localVersion < tokenVersion) {
        logError("app-library version is in advance, need to restart from scratch " +
                 versionComparison(tokenVersion, localVersion, mainCacheVersion));
        observer.finishEnumeratingWithError(Error::syncAnchorExpired());
        return false;
    }
    // The working set also drops the search index of vanished libraries, and keeps its own
    // cache in step with what the host was told.
    const bool workingSet = isWorkingSet();
    if (tokenVersion == 0) {
        logDebug("change token version is zero, let's send all the app-libraries known");
        if (appLibraryManager_->upgradeFromMainCache(nullptr, workingSet)) {
            updateMonitoredURLs();
            if (workingSet)
                saveWorkingSetCache();
        }
        observer.didUpdateItems(hostItems(appLibraryManager_->allItems()));
        token.appLibraryVersionToken = appLibraryManager_->versionToken();
    } else if (tokenVersion != localVersion) {
        logError("change token version matches nothing, need to restart from scratch " +
                 versionComparison(tokenVersion, localVersion, mainCacheVersion));
        observer.finishEnumeratingWithError(Error::syncAnchorExpired());
        return false;
    } else {
        logDebug("change token version matches local version");
        if (appLibraryManager_->upgradeFromMainCache(&observer, workingSet)) {
            updateMonitoredURLs();
            if (workingSet)
                saveWorkingSetCache();
            token.appLibraryVersionToken = appLibraryManager_->versionToken();
        }
    }
    return true;
}

void LocalRootEnumerator::saveWorkingSetCache() {
    if (Status saved = appLibraryManager_->saveToCache(); !saved.ok())
        logError("can't save working-set cache to disk; " + saved.error().description());
}

void LocalRootEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<HostPorterSyncAnchor>)> completion) {
    localFileEnumerator()->currentSyncAnchorWithCompletionHandler(
        [completion = std::move(completion),
         manager = appLibraryManager_](std::optional<HostPorterSyncAnchor> anchor) {
            std::optional<FSChangeToken> token =
                anchor ? FSChangeToken::decode(*anchor) : std::nullopt;
            if (!token) {
                completion(std::nullopt);
                return;
            }
            token->appLibraryVersionToken = manager->versionToken();
            completion(token->encode());
        });
}

}  // namespace tamber
