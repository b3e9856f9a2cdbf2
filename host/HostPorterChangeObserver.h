#pragma once

#include <vector>

#include "host/HostPorterItem.h"
#include "host/HostPorterPage.h"
#include "support/Error.h"

namespace tamber {

// Receives the changes since a sync anchor, in batches, then the anchor to resume from.
class HostPorterChangeObserver {
public:
    virtual ~HostPorterChangeObserver() = default;
    virtual void didUpdateItems(const std::vector<HostPorterItemRef>& items) = 0;
    virtual void didDeleteItemsWithIdentifiers(
        const std::vector<HostPorterItemIdentifier>& identifiers) = 0;
    virtual void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& anchor,
                                                        bool moreComing) = 0;
    virtual void finishEnumeratingWithError(const Error& error) = 0;
    virtual size_t suggestedBatchSize() const { return 200; }
};

}  // namespace tamber
