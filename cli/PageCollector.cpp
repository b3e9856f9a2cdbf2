#include "cli/PageCollector.h"

#include "support/Log.h"

namespace tamber {

void PageCollector::didEnumerateItems(const std::vector<HostPorterItemRef>& page) {
    std::lock_guard lock(mutex_);
    items.insert(items.end(), page.begin(), page.end());
}

void PageCollector::finishEnumeratingUpToPage(const std::optional<HostPorterPage>& next) {
    {
        std::lock_guard lock(mutex_);
        nextPage = next;
    }
    finish();
}

void PageCollector::finishEnumeratingWithError(const Error& failure) {
    {
        std::lock_guard lock(mutex_);
        error = failure;
    }
    finish();
}

void PageCollector::finish() {
    std::lock_guard lock(mutex_);
    // A second finish would be the provider's bug; the first answer stands.
    if (done_) {
        logError("a listing page was finished twice");
        return;
    }
    done_ = true;
    finished_.signal();
}

}  // namespace tamber
