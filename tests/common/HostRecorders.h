#pragma once

#include <mutex>
#include <optional>
#include <utility>
#include <vector>

#include "host/HostPorterChangeObserver.h"
#include "host/HostPorterEnumerationObserver.h"
#include "support/DispatchSemaphore.h"
#include "support/Error.h"

namespace tamber::testing {

// What a host gets from one page of a listing, and from one batch of changes, with a
// semaphore signalled once the provider has finished either.
struct PageRecorder : HostPorterEnumerationObserver {
    void didEnumerateItems(const std::vector<HostPorterItemRef>& page) override {
        items.insert(items.end(), page.begin(), page.end());
    }
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& page) override {
        next = page;
        done.signal();
    }
    void finishEnumeratingWithError(const Error& e) override {
        error = e;
        done.signal();
    }
    std::vector<HostPorterItemRef> items;
    std::optional<HostPorterPage> next;
    std::optional<Error> error;
    DispatchSemaphore done;
};

struct BatchRecorder : HostPorterChangeObserver {
    // Changes in the order they came: a deletion and a later update of the same identifier (a
    // folder's number reused) must be applied in that order.
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        std::lock_guard lock(mutex);
        for (const auto& item : items) changes.push_back({item, {}});
    }
    void didDeleteItemsWithIdentifiers(const std::vector<HostPorterItemIdentifier>& ids) override {
        std::lock_guard lock(mutex);
        for (const auto& id : ids) changes.push_back({nullptr, id});
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& a, bool more) override {
        {
            std::lock_guard lock(mutex);
            anchor = a;
            moreComing = more;
        }
        done.signal();
    }
    void finishEnumeratingWithError(const Error& e) override {
        {
            std::lock_guard lock(mutex);
            error = e;
        }
        done.signal();
    }
    std::mutex mutex;
    std::vector<std::pair<HostPorterItemRef, HostPorterItemIdentifier>> changes;
    HostPorterSyncAnchor anchor;
    bool moreComing = false;
    std::optional<Error> error;
    DispatchSemaphore done;
};

}  // namespace tamber::testing
