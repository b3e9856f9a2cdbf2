#include "host/RecordingHostPorterManager.h"

namespace tamber {

RecordingHostPorterManager::RecordingHostPorterManager(Url documentStorage)
    : storage_(std::move(documentStorage)) {}

Url RecordingHostPorterManager::documentStorageURL() const {
    std::lock_guard lock(mutex_);
    return storage_;
}

void RecordingHostPorterManager::signalEnumeratorForContainerItemIdentifier(
    const HostPorterItemIdentifier& container, Completion completion) {
    std::optional<Error> error;
    {
        std::lock_guard lock(mutex_);
        signals_.push_back(container);
        error = signalError_;
    }
    if (completion)
        completion(error);
}

void RecordingHostPorterManager::deleteSearchableItemsWithDomainIdentifiers(
    const std::vector<std::string>& domainIdentifiers, Completion completion) {
    {
        std::lock_guard lock(mutex_);
        deletions_.push_back(domainIdentifiers);
    }
    if (completion)
        completion(std::nullopt);
}

std::vector<HostPorterItemIdentifier> RecordingHostPorterManager::signals() const {
    std::lock_guard lock(mutex_);
    return signals_;
}

std::vector<std::vector<std::string>> RecordingHostPorterManager::deletions() const {
    std::lock_guard lock(mutex_);
    return deletions_;
}

void RecordingHostPorterManager::setStorageURL(Url url) {
    std::lock_guard lock(mutex_);
    storage_ = std::move(url);
}

void RecordingHostPorterManager::setSignalError(std::optional<Error> error) {
    std::lock_guard lock(mutex_);
    signalError_ = std::move(error);
}

void RecordingHostPorterManager::clear() {
    std::lock_guard lock(mutex_);
    signals_.clear();
    deletions_.clear();
}

}  // namespace tamber
