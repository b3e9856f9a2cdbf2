#pragma once

#include <memory>
#include <set>
#include <vector>

#include "fs/FSChangeToken.h"
#include "fs/FSChangesEnumerator.h"
#include "fs/FSChangesNotifier.h"
#include "host/HostPorterEnumerator.h"
#include "platform/Url.h"
#include "support/Mutex.h"

namespace tamber {

// Lists one container in pages of 200 (the gather phase) and answers its changes since an
// anchor. Every page token is an encoded FSChangeToken holding the event ID at which the gather
// phase began, so that the change enumeration that follows misses nothing made meanwhile.
// Which trees are listed depends on the container: the working set and all-directories walk
// every root recursively (the working set adds each root's ".Trash" top level), any other
// container lists its folder's direct children.
class LocalFileEnumerator : public HostPorterEnumerator,
                            public std::enable_shared_from_this<LocalFileEnumerator> {
    struct Private {};

public:
    static constexpr uint64_t kPageSize = 200;

    // An empty URL list is fatal. Without a notifier (logged) there are no live updates and no
    // current anchor.
    static std::shared_ptr<LocalFileEnumerator> initWithContainer(
        HostPorterItemIdentifier container, std::vector<Url> urls);
    LocalFileEnumerator(Private, HostPorterItemIdentifier container, std::vector<Url> urls);
    ~LocalFileEnumerator() override;

    void enumerateItemsForObserver(std::shared_ptr<HostPorterEnumerationObserver> observer,
                                   const HostPorterPage& page) override;
    void enumerateChangesForObserver(std::shared_ptr<HostPorterChangeObserver> observer,
                                     const HostPorterSyncAnchor& anchor) override;
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<HostPorterSyncAnchor>)> completion) override;
    void invalidate() override;

    // Changes enumeration from an already decoded token (the root enumerator decodes first).
    void enumerateChangesForObserver(std::shared_ptr<HostPorterChangeObserver> observer,
                                     const FSChangeToken& token);

    void start();
    void stop();
    void removeEnumerator(const FSChangesEnumeratorRef& enumerator);

    const HostPorterItemIdentifier& container() const { return container_; }
    const Url& enumeratedItemURL() const { return enumeratedItemURL_; }
    const std::vector<Url>& urls() const { return urls_; }
    const FSChangesNotifierRef& notifier() const { return notifier_; }
    bool shouldUpdateFileIDInStrata() const;
    size_t runningEnumeratorCount() const;

private:
    // The records of a page's URLs, in order; those that can't be built are left out.
    static std::vector<HostPorterItemRef> makeItems(const std::vector<Url>& urls);
    void gatherPhase(HostPorterEnumerationObserver& observer,
                     const std::optional<FSChangeToken>& token);
    // The roots a page walks, in order, and whether it walks them whole.
    std::vector<Url> listedRoots() const;
    bool listsRecursively() const;

    HostPorterItemIdentifier container_;
    Url enumeratedItemURL_;
    std::vector<Url> urls_;
    FSChangesNotifierRef notifier_;
    // Change enumerations start and end on their own queues.
    mutable Mutex mutex_;
    std::set<FSChangesEnumeratorRef> enumerators_ GUARDED_BY(mutex_);
    bool notifierStarted_ GUARDED_BY(mutex_) = false;
};

using LocalFileEnumeratorRef = std::shared_ptr<LocalFileEnumerator>;

}  // namespace tamber
