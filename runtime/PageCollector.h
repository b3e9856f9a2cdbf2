#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "host/HostPorterEnumerationObserver.h"
#include "runtime/CompletionWaiter.h"

namespace tamber {

// Collects one page of a listing, for a host that waits for it.
class PageCollector : public HostPorterEnumerationObserver {
public:
    struct Page {
        std::vector<HostPorterItemRef> items;
        std::optional<HostPorterPage> nextPage;  // nothing after the last page
        std::optional<Error> error;
    };

    void didEnumerateItems(const std::vector<HostPorterItemRef>& items) override;
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& nextPage) override;
    void finishEnumeratingWithError(const Error& error) override;

    // Waits for the page to finish (a listing runs to its end: no time limit). Call once.
    Page wait() { return finished_->wait(); }

private:
    // A second finish would be the provider's bug: the first answer stands, and it is logged.
    void finish(std::optional<HostPorterPage> nextPage, std::optional<Error> error);

    std::mutex mutex_;
    std::vector<HostPorterItemRef> items_;  // guarded by mutex_
    std::shared_ptr<CompletionWaiter<Page>> finished_ = std::make_shared<CompletionWaiter<Page>>();
};

}  // namespace tamber
