#pragma once

#include <memory>
#include <mutex>
#include <optional>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterItemIdentifier.h"

namespace tamber {

class ServerClient;

// A container's listing and changes, asked of a running server: each page and each batch of
// changes is one request, and page tokens and anchors travel as the same bytes in base64. The
// observer is called on the caller's thread, before the call returns.
class RemoteEnumerator : public HostPorterEnumerator {
public:
    // `anchor` is the container's current anchor when the caller already asked for it.
    RemoteEnumerator(std::shared_ptr<ServerClient> client, HostPorterItemIdentifier container,
                     std::optional<HostPorterSyncAnchor> anchor = std::nullopt);

    void invalidate() override {}
    void enumerateItemsForObserver(std::shared_ptr<HostPorterEnumerationObserver> observer,
                                   const HostPorterPage& page) override;
    void enumerateChangesForObserver(std::shared_ptr<HostPorterChangeObserver> observer,
                                     const HostPorterSyncAnchor& anchor) override;
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<HostPorterSyncAnchor>)> completion) override;

private:
    std::string containerPath() const;

    std::shared_ptr<ServerClient> client_;
    HostPorterItemIdentifier container_;
    std::mutex mutex_;
    std::optional<HostPorterSyncAnchor> anchor_;  // guarded by mutex_; used once
};

}  // namespace tamber
