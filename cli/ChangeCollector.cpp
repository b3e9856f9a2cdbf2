#include "cli/ChangeCollector.h"

#include "support/Log.h"

namespace tamber {

void ChangeCollector::didUpdateItems(const std::vector<HostPorterItemRef>& items) {
    std::lock_guard lock(mutex_);
    updated.insert(updated.end(), items.begin(), items.end());
    for (const auto& item : items) changes.push_back({item, {}});
}

void ChangeCollector::didDeleteItemsWithIdentifiers(
    const std::vector<HostPorterItemIdentifier>& identifiers) {
    std::lock_guard lock(mutex_);
    deleted.insert(deleted.end(), identifiers.begin(), identifiers.end());
    for (const auto& identifier : identifiers) changes.push_back({nullptr, identifier});
}

void ChangeCollector::finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& next,
                                                             bool more) {
    {
        std::lock_guard lock(mutex_);
        anchor = next;
        moreComing = more;
    }
    finish();
}

void ChangeCollector::finishEnumeratingWithError(const Error& failure) {
    {
        std::lock_guard lock(mutex_);
        error = failure;
    }
    finish();
}

void ChangeCollector::finish() {
    std::lock_guard lock(mutex_);
    if (done_) {
        logError("a change batch was finished twice");
        return;
    }
    done_ = true;
    finished_.signal();
}

}  // namespace tamber
