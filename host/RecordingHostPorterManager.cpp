#include "host/RecordingHostPorterManager.h"
#include "support/MutexLock.h"

namespace tamber {

RecordingHostPorterManager::RecordingHostPorterManager(Url documentStorage)
    : storage_(std::move(documentStorage)) {}

Url RecordingHostPorterManager::documentStorageURL() const {
    MutexLock lock(mutex_);
    return storage_;
}

void RecordingHostPorterManager::signalEnumeratorForContainerItemIdentifier(
    const HostPorterItemIdentifier& container, Completion completion) {
    std::optional<Error> error;
    {
        MutexLock lock(mutex_);
        signals_.push_back(container);
        error = signalError_;
    }
    if (completion)
        completion(error);
}

void RecordingHostPorterManager::deleteSearchableItemsWithDomainIdentifiers(
    const std::vector<std::string>& domainIdentifiers, Completion completion) {
    {
        MutexLock lock(mutex_);
        deletions_.push_back(domainIdentifiers);
    }
    if (completion)
        completion(std::nullopt);
}

std::vector<HostPorterItemIdentifier> RecordingHostPorterManager::signals() const {
    MutexLock lock(mutex_);
    return signals_;
}

std::vector<std::vector<std::string>> RecordingHostPorterManager::deletions() const {
    MutexLock lock(mutex_);
    return deletions_;
}

void RecordingHostPorterManager::setStorageURL(Url url) {
    MutexLock lock(mutex_);
    storage_ = std::move(url);
}

void RecordingHostPorterManager::setSignalError(std::optional<Error> error) {
    MutexLock lock(mutex_);
    signalError_ = std::move(error);
}

void RecordingHostPorterManager::clear() {
    MutexLock lock(mutex_);
    signals_.clear();
    deletions_.clear();
}

}  // namespace tamber
