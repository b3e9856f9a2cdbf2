#include "applibraries/LocalAppLibraryManager.h"

#include <algorithm>
#include <cstdio>
#include <mutex>

#include "applibraries/LocalAppLibraryCache.h"
#include "host/HostPorterManager.h"
#include "items/LocalAppLibraryItem.h"
#include "platform/apps/AppRecord.h"
#include "platform/apps/AppRegistry.h"
#include "platform/objects/Array.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "support/DispatchSemaphore.h"
#include "support/Log.h"
#include "support/LogSection.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

constexpr const char* kDocumentBrowserKey = "HostSupportsDocumentBrowser";

struct SharedManager {
    std::mutex mutex;
    std::shared_ptr<LocalAppLibraryManager> manager;
};

SharedManager& sharedManager() {
    // Lookups may still arrive while the process exits.
    static ProcessWide<SharedManager> shared;
    return *shared;
}

bool publishesDocuments(const AppRecord& app) {
    if (const auto& info = app.infoDictionary()) {
        auto flag = objectCast<Number>(info->objectForKey(kDocumentBrowserKey));
        if (flag && flag->kind() == Number::Kind::Boolean && flag->boolValue())
            return true;
    }
    return app.supportsOpenInPlace() && app.fileSharingEnabled();
}

std::string describeRecords(const std::vector<BundleRecordRef>& records) {
    return Array::make(std::vector<ObjectRef>(records.begin(), records.end()))->description();
}

std::string describeIdentifiers(const std::vector<HostPorterItemIdentifier>& identifiers) {
    std::vector<ObjectRef> strings;
    strings.reserve(identifiers.size());
    for (const auto& identifier : identifiers) strings.push_back(String::make(identifier));
    return Array::make(std::move(strings))->description();
}

// The applications of the default registry that publish documents, in registry order.
std::vector<BundleRecordRef> registeredAppLibraries() {
    LogSection section("retrieving app libraries from appmint");
    std::vector<BundleRecordRef> records;
    auto registry = AppRegistry::defaultRegistry();
    for (int type : {AppRegistry::kUserApplications, AppRegistry::kSystemApplications}) {
        registry->enumerateApplicationsOfType(type, [&](const BundleRecordRef& record, bool&) {
            if (!record) {
                logError("enumerate Application provided nil proxy");
                return;
            }
            auto app = std::dynamic_pointer_cast<const AppRecord>(record);
            if (!app || !app->dataContainerURL() || !publishesDocuments(*app))
                return;
            logDebug([&] { return "add " + app->bundleIdentifier().value_or("<unknown>"); });
            records.push_back(record);
        });
    }
    logDebug([&] { return "bundle proxies " + describeRecords(records); });
    return records;
}

// Only the data containers count, position by position: a reordering is a change.
bool sameContainers(const std::vector<BundleRecordRef>& a, const std::vector<BundleRecordRef>& b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                      [](const BundleRecordRef& x, const BundleRecordRef& y) {
                          return x->dataContainerURL() == y->dataContainerURL();
                      });
}

}  // namespace

std::shared_ptr<LocalAppLibraryManager> LocalAppLibraryManager::init(
    LocalAppLibraryCacheSource cacheSource) {
    return std::make_shared<LocalAppLibraryManager>(Private{}, cacheSource, false);
}

std::shared_ptr<LocalAppLibraryManager> LocalAppLibraryManager::shared() {
    SharedManager& shared = sharedManager();
    std::lock_guard lock(shared.mutex);
    if (!shared.manager) {
        shared.manager = std::make_shared<LocalAppLibraryManager>(
            Private{}, LocalAppLibraryCacheSource::workingSet, true);
    }
    return shared.manager;
}

void LocalAppLibraryManager::resetSharedForTesting() {
    SharedManager& shared = sharedManager();
    std::lock_guard lock(shared.mutex);
    shared.manager.reset();
}

DispatchQueue& LocalAppLibraryManager::backgroundQueue() {
    // A refresh may still run while the process exits.
    static ProcessWide<std::shared_ptr<DispatchQueue>> queue(
        DispatchQueue::makeSerial("tamber.app-library.background"));
    return **queue;
}

LocalAppLibraryManager::LocalAppLibraryManager(Private, LocalAppLibraryCacheSource cacheSource,
                                               bool isShared)
    : cacheSource_(cacheSource),
      queue_(DispatchQueue::makeSerial("tamber.app-library-manager")),
      isShared_(isShared) {
    LogSection section("loading bundle proxies from " + std::string(toString(cacheSource_)));
    auto cache = LocalAppLibraryCache::forSource(cacheSource_);
    auto loaded = cache->queue().sync([&] { return cache->load(); });
    // Nobody else can see the manager yet; the queue is not needed to set its first content.
    content_ = buildContent(loaded.versionToken, loaded.bundleRecords, BuildContext::creation);
    std::atomic_store(&published_, content_);
}

LocalAppLibraryManager::ContentRef LocalAppLibraryManager::buildContent(
    uint64_t versionToken, const std::vector<BundleRecordRef>& records, BuildContext context) {
    auto content = std::make_shared<Content>();
    content->versionToken = versionToken;
    for (const BundleRecordRef& record : records) {
        auto item = LocalAppLibraryItem::initFrom(record);
        if (!item) {
            logError((context == BuildContext::creation
                          ? "can't create app library from bundle proxy "
                          : "can't create app library for ") +
                     record->description());
            continue;
        }
        content->appLibrariesByItemIDs[item->itemIdentifier()] = item;
        content->bundleProxiesByRootURLs[item->fileURL()] = record;
    }
    content->rootURLs.reserve(content->bundleProxiesByRootURLs.size());
    for (const auto& [url, record] : content->bundleProxiesByRootURLs)
        content->rootURLs.push_back(url);
    return content;
}

void LocalAppLibraryManager::setContent(ContentRef content) {
    queue_->assertCurrent();
    content_ = std::move(content);
    std::atomic_store(&published_, content_);
}

LocalAppLibraryManager::ContentRef LocalAppLibraryManager::currentContent() const {
    return queue_->sync([this] { return content_; });
}

LocalAppLibraryManager::ContentRef LocalAppLibraryManager::publishedContent() const {
    return std::atomic_load(&published_);
}

bool LocalAppLibraryManager::refresh() {
    LogSection section("refreshing app libraries");
    std::vector<BundleRecordRef> records = registeredAppLibraries();

    auto mainCache = LocalAppLibraryCache::mainCache();
    auto previous = mainCache->queue().sync([&] { return mainCache->load(); });
    if (sameContainers(records, previous.bundleRecords)) {
        logDebug("bundle proxies are identical to previous version");
        return false;
    }

    auto saved = mainCache->queue().sync([&] { return mainCache->save(records, 0, true); });
    if (!saved.ok()) {
        logError("can't refresh app libraries; " + saved.error().description());
        return false;
    }
    logDebug("main cache version token is now " + std::to_string(saved.value()));
    return true;
}

bool LocalAppLibraryManager::upgradeFromMainCache(HostPorterChangeObserver* observer,
                                                  bool deleteIndex) {
    LogSection section("upgrading content from main cache");
    auto mainCache = LocalAppLibraryCache::mainCache();
    uint64_t mainToken = mainCache->queue().sync([&] { return mainCache->versionToken(); });
    ContentRef old = currentContent();
    if (mainToken == old->versionToken)
        return false;
    if (old->versionToken > mainToken) {
        logError("version token shouldn't be greater than the main's cache version (" +
                 std::to_string(old->versionToken) + " vs " + std::to_string(mainToken) + "); " +
                 describe(*old));
    }

    auto loaded = mainCache->queue().sync([&] { return mainCache->load(); });
    ContentRef fresh =
        buildContent(loaded.versionToken, loaded.bundleRecords, BuildContext::upgrade);

    if (observer && !fresh->appLibrariesByItemIDs.empty()) {
        std::vector<HostPorterItemRef> items;
        items.reserve(fresh->appLibrariesByItemIDs.size());
        for (const auto& [identifier, item] : fresh->appLibrariesByItemIDs) items.push_back(item);
        observer->didUpdateItems(items);
    }

    std::vector<HostPorterItemIdentifier> removed;
    for (const auto& [identifier, item] : old->appLibrariesByItemIDs) {
        if (!fresh->appLibrariesByItemIDs.contains(identifier))
            removed.push_back(identifier);
    }
    if (!removed.empty()) {
        if (observer)
            observer->didDeleteItemsWithIdentifiers(removed);
        if (deleteIndex) {
            logDebug("asking provider manager to delete index from deleted domains");
            // Shared with the completion, which may still be returning after the wait ends.
            auto done = std::make_shared<DispatchSemaphore>();
            HostPorterManager::defaultManager()->deleteSearchableItemsWithDomainIdentifiers(
                removed, [done, list = describeIdentifiers(removed)](std::optional<Error> error) {
                    if (error) {
                        logError("can't delete searchable items from " + list + "; " +
                                 error->description());
                    } else {
                        logDebug("items from domains " + list + " removed from index");
                    }
                    done->signal();
                });
            done->wait();
        }
    }

    queue_->sync([&] {
        setContent(fresh);
        logDebug([&] { return "upgraded manager " + describe(*fresh); });
    });
    return true;
}

Status LocalAppLibraryManager::saveToCache() {
    LogSection section("saving bundle proxies to " + std::string(toString(cacheSource_)));
    ContentRef content = currentContent();
    std::vector<BundleRecordRef> records;
    records.reserve(content->bundleProxiesByRootURLs.size());
    for (const auto& [url, record] : content->bundleProxiesByRootURLs) records.push_back(record);
    auto cache = LocalAppLibraryCache::forSource(cacheSource_);
    auto saved =
        cache->queue().sync([&] { return cache->save(records, content->versionToken, false); });
    if (!saved.ok())
        return saved.error();
    return Status::OK();
}

uint64_t LocalAppLibraryManager::versionToken() const {
    return currentContent()->versionToken;
}

std::vector<LocalAppLibraryItemRef> LocalAppLibraryManager::allItems() const {
    ContentRef content = currentContent();
    std::vector<LocalAppLibraryItemRef> items;
    items.reserve(content->appLibrariesByItemIDs.size());
    for (const auto& [identifier, item] : content->appLibrariesByItemIDs) items.push_back(item);
    return items;
}

LocalAppLibraryItemRef LocalAppLibraryManager::itemForIdentifier(
    const HostPorterItemIdentifier& identifier) const {
    ContentRef content = currentContent();
    auto it = content->appLibrariesByItemIDs.find(identifier);
    return it == content->appLibrariesByItemIDs.end() ? nullptr : it->second;
}

LocalAppLibraryManager::AppLibrariesByItemIDs LocalAppLibraryManager::appLibrariesByItemIDs()
    const {
    return currentContent()->appLibrariesByItemIDs;
}

std::vector<Url> LocalAppLibraryManager::rootURLs() const {
    return publishedContent()->rootURLs;
}

LocalAppLibraryManager::BundleProxiesByRootURLs LocalAppLibraryManager::bundleProxiesByRootURLs()
    const {
    return publishedContent()->bundleProxiesByRootURLs;
}

BundleRecordRef LocalAppLibraryManager::bundleProxyFor(const Url& url,
                                                       UrlRelationship relationship) const {
    ContentRef content = publishedContent();
    for (const auto& [root, record] : content->bundleProxiesByRootURLs) {
        if (pt_relationshipToItemAtURL(root, url) == relationship)
            return record;
    }
    return nullptr;
}

std::string LocalAppLibraryManager::description() const {
    if (queue_->isCurrent())
        return describe(*content_);
    return describe(*currentContent());
}

std::string LocalAppLibraryManager::describe(const Content& content) const {
    char address[2 + 2 * sizeof(void*) + 1];
    std::snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
    return "<LocalAppLibraryManager:" + std::string(address) + (isShared_ ? " SHARED" : "") +
           " versionToken:" + std::to_string(content.versionToken) +
           " cache-source:" + std::string(toString(cacheSource_)) +
           " app-libraries:" + std::to_string(content.appLibrariesByItemIDs.size()) + ">";
}

}  // namespace tamber
