#pragma once

#include <mutex>
#include <optional>
#include <vector>

#include "host/HostPorterChangeObserver.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

// Collects one batch of changes, for a verb that waits for it.
class ChangeCollector : public HostPorterChangeObserver {
public:
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override;
    void didDeleteItemsWithIdentifiers(
        const std::vector<HostPorterItemIdentifier>& identifiers) override;
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& anchor,
                                                bool moreComing) override;
    void finishEnumeratingWithError(const Error& error) override;

    // Whether the batch finished within `timeoutSeconds`.
    bool wait(double timeoutSeconds) { return finished_.wait(timeoutSeconds); }

    // Read after a successful wait().
    std::vector<HostPorterItemRef> updated;
    std::vector<HostPorterItemIdentifier> deleted;
    // Both, in the order they came: an identifier deleted and then updated (a folder's number
    // reused) must be applied in that order.
    struct Change {
        HostPorterItemRef item;                // an update, or
        HostPorterItemIdentifier deletedItem;  // a deletion
    };
    std::vector<Change> changes;
    std::optional<HostPorterSyncAnchor> anchor;
    bool moreComing = false;
    std::optional<Error> error;

private:
    void finish();

    std::mutex mutex_;
    bool done_ = false;
    DispatchSemaphore finished_;
};

}  // namespace tamber
