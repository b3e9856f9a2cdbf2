#pragma once

#include <mutex>
#include <optional>
#include <vector>

#include "host/HostPorterEnumerationObserver.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

// Collects one page of a listing, for a verb that waits for it.
class PageCollector : public HostPorterEnumerationObserver {
public:
    void didEnumerateItems(const std::vector<HostPorterItemRef>& items) override;
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& nextPage) override;
    void finishEnumeratingWithError(const Error& error) override;

    // Waits for the page to finish (a listing runs to its end: no time limit).
    void wait() { finished_.wait(); }

    // Read after wait().
    std::vector<HostPorterItemRef> items;
    std::optional<HostPorterPage> nextPage;
    std::optional<Error> error;

private:
    void finish();

    std::mutex mutex_;
    bool done_ = false;
    DispatchSemaphore finished_;
};

}  // namespace tamber
