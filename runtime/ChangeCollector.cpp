#include "runtime/ChangeCollector.h"

#include "support/Log.h"

namespace tamber {

void ChangeCollector::didUpdateItems(const std::vector<HostPorterItemRef>& items) {
    std::lock_guard lock(mutex_);
    batch_.updated.insert(batch_.updated.end(), items.begin(), items.end());
    for (const auto& item : items) batch_.changes.push_back({item, {}});
}

void ChangeCollector::didDeleteItemsWithIdentifiers(
    const std::vector<HostPorterItemIdentifier>& identifiers) {
    std::lock_guard lock(mutex_);
    batch_.deleted.insert(batch_.deleted.end(), identifiers.begin(), identifiers.end());
    for (const auto& identifier : identifiers) batch_.changes.push_back({nullptr, identifier});
}

void ChangeCollector::finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& next,
                                                             bool more) {
    finish(next, more, std::nullopt);
}

void ChangeCollector::finishEnumeratingWithError(const Error& failure) {
    finish(std::nullopt, false, failure);
}

void ChangeCollector::finish(std::optional<HostPorterSyncAnchor> anchor, bool moreComing,
                             std::optional<Error> error) {
    Batch batch;
    {
        std::lock_guard lock(mutex_);
        batch = batch_;
    }
    batch.anchor = std::move(anchor);
    batch.moreComing = moreComing;
    batch.error = std::move(error);
    if (!finished_->finish(std::move(batch)))
        logError("a change batch was finished twice");
}

}  // namespace tamber
