#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "host/HostPorterChangeObserver.h"
#include "runtime/CompletionWaiter.h"

namespace tamber {

// Collects one batch of changes, for a host that waits for it.
class ChangeCollector : public HostPorterChangeObserver {
public:
    struct Change {
        HostPorterItemRef item;                // an update, or
        HostPorterItemIdentifier deletedItem;  // a deletion
    };
    struct Batch {
        std::vector<HostPorterItemRef> updated;
        std::vector<HostPorterItemIdentifier> deleted;
        // Both, in the order they came: an identifier deleted and then updated (a folder's
        // number reused) must be applied in that order.
        std::vector<Change> changes;
        std::optional<HostPorterSyncAnchor> anchor;
        bool moreComing = false;
        std::optional<Error> error;
    };

    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override;
    void didDeleteItemsWithIdentifiers(
        const std::vector<HostPorterItemIdentifier>& identifiers) override;
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& anchor,
                                                bool moreComing) override;
    void finishEnumeratingWithError(const Error& error) override;

    // The batch, or nothing when it did not finish within `timeoutSeconds` (ask again).
    std::optional<Batch> waitFor(double timeoutSeconds) {
        return finished_->waitFor(timeoutSeconds);
    }

private:
    // A second finish would be the provider's bug: the first answer stands, and it is logged.
    void finish(std::optional<HostPorterSyncAnchor> anchor, bool moreComing,
                std::optional<Error> error);

    std::mutex mutex_;
    Batch batch_;  // guarded by mutex_: the changes so far
    std::shared_ptr<CompletionWaiter<Batch>> finished_ =
        std::make_shared<CompletionWaiter<Batch>>();
};

}  // namespace tamber
