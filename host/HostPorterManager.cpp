#include "host/HostPorterManager.h"

#include <atomic>

#include "support/Log.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

std::shared_ptr<HostPorterManager>& slot() {
    static ProcessWide<std::shared_ptr<HostPorterManager>> manager;
    return *manager;
}

}  // namespace

std::shared_ptr<HostPorterManager> HostPorterManager::defaultManager() {
    auto manager = std::atomic_load(&slot());
    if (!manager)
        fatalError("no HostPorterManager installed before the provider started");
    return manager;
}

std::shared_ptr<HostPorterManager> HostPorterManager::installedManager() {
    return std::atomic_load(&slot());
}

std::shared_ptr<HostPorterManager> HostPorterManager::installDefaultManager(
    std::shared_ptr<HostPorterManager> manager) {
    return std::atomic_exchange(&slot(), std::move(manager));
}

StorageHostPorterManager::StorageHostPorterManager(Url documentStorage, SignalHandler onSignal,
                                                   IndexDeletionHandler onDeleteIndex)
    : storage_(std::move(documentStorage)),
      onSignal_(std::move(onSignal)),
      onDeleteIndex_(std::move(onDeleteIndex)) {}

void StorageHostPorterManager::signalEnumeratorForContainerItemIdentifier(
    const HostPorterItemIdentifier& container, Completion completion) {
    if (onSignal_)
        onSignal_(container);
    if (completion)
        completion(std::nullopt);
}

void StorageHostPorterManager::deleteSearchableItemsWithDomainIdentifiers(
    const std::vector<std::string>& domainIdentifiers, Completion completion) {
    if (onDeleteIndex_)
        return onDeleteIndex_(domainIdentifiers, std::move(completion));
    // Nothing indexes published items, so there is nothing to delete.
    if (completion)
        completion(std::nullopt);
}

}  // namespace tamber
