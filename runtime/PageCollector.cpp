#include "runtime/PageCollector.h"

#include "support/Log.h"

namespace tamber {

void PageCollector::didEnumerateItems(const std::vector<HostPorterItemRef>& page) {
    std::lock_guard lock(mutex_);
    items_.insert(items_.end(), page.begin(), page.end());
}

void PageCollector::finishEnumeratingUpToPage(const std::optional<HostPorterPage>& next) {
    finish(next, std::nullopt);
}

void PageCollector::finishEnumeratingWithError(const Error& failure) {
    finish(std::nullopt, failure);
}

void PageCollector::finish(std::optional<HostPorterPage> nextPage, std::optional<Error> error) {
    Page page;
    {
        std::lock_guard lock(mutex_);
        page.items = items_;
    }
    page.nextPage = std::move(nextPage);
    page.error = std::move(error);
    if (!finished_->finish(std::move(page)))
        logError("a listing page was finished twice");
}

}  // namespace tamber
