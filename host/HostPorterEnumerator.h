#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "host/HostPorterChangeObserver.h"
#include "host/HostPorterEnumerationObserver.h"

namespace tamber {

// Lists one container in pages and reports its changes since an anchor.
class HostPorterEnumerator {
public:
    virtual ~HostPorterEnumerator() = default;
    // The host no longer needs the enumerator: stop everything it runs.
    virtual void invalidate() = 0;
    virtual void enumerateItemsForObserver(std::shared_ptr<HostPorterEnumerationObserver> observer,
                                           const HostPorterPage& page) = 0;
    virtual void enumerateChangesForObserver(std::shared_ptr<HostPorterChangeObserver> observer,
                                             const HostPorterSyncAnchor& anchor) = 0;
    virtual void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<HostPorterSyncAnchor>)> completion) = 0;
};

using HostPorterEnumeratorRef = std::shared_ptr<HostPorterEnumerator>;

}  // namespace tamber
