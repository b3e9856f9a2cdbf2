#pragma once

#include <memory>

#include "fs/FSChangesEnumerator.h"
#include "host/HostPorterChangeObserver.h"
#include "support/Mutex.h"

namespace tamber {

class LocalFileEnumerator;

// Sits between a running change enumeration and the host's observer: forwards every call,
// optionally asks the document-ID service about each updated item first, and detaches the
// change enumerator from its folder enumerator when the enumeration ends.
class LocalChangesObserverContext : public HostPorterChangeObserver {
public:
    LocalChangesObserverContext(std::shared_ptr<HostPorterChangeObserver> observer,
                                std::shared_ptr<LocalFileEnumerator> localFileEnumerator,
                                bool shouldUpdateFileIDInStrata);

    void setFSChangesEnumerator(std::weak_ptr<FSChangesEnumerator> enumerator);

    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override;
    void didDeleteItemsWithIdentifiers(
        const std::vector<HostPorterItemIdentifier>& identifiers) override;
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& anchor,
                                                bool moreComing) override;
    void finishEnumeratingWithError(const Error& error) override;

private:
    void endChangeEnumerator();

    std::shared_ptr<HostPorterChangeObserver> observer_;
    std::shared_ptr<LocalFileEnumerator> localFileEnumerator_;
    std::weak_ptr<FSChangesEnumerator> fsChangesEnumerator_;
    bool shouldUpdateFileIDInStrata_;
    // The record looked up last. A reader sends the one record it read for a file with every
    // event of a batch that names the file; asking about the same record again learns nothing.
    Mutex mutex_;
    HostPorterItemRef lastLookedUp_ GUARDED_BY(mutex_);
};

}  // namespace tamber
