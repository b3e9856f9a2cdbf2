#include "enumeration/LocalChangesObserverContext.h"

#include "enumeration/LocalFileEnumerator.h"
#include "items/LocalItem.h"
#include "platform/FileSystem.h"
#include "platform/strata/StrataService.h"
#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

namespace {

// Asks the document-ID index about the item's file without allocating anything: the answer is
// not needed, the look-up is what brings the index up to date. Failures change nothing about
// what is reported and are not logged.
void updateFileIDInStrata(const HostPorterItemRef& item) {
    logDebug("updating file ID in strata");
    auto local = std::dynamic_pointer_cast<const LocalItem>(item);
    if (!local)
        return;
    const Url& url = local->fileURL();
    std::shared_ptr<StrataService> strata = StrataService::current();
    if (!strata || !url.isFileURL())
        return;
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, url.path(), AT_SYMLINK_NOFOLLOW, STATX_INO, &st) != 0)
        return;
    (void)strata->documentIdForInode(encodeDevice(st.stx_dev_major, st.stx_dev_minor), st.stx_ino);
}

}  // namespace

LocalChangesObserverContext::LocalChangesObserverContext(
    std::shared_ptr<HostPorterChangeObserver> observer,
    std::shared_ptr<LocalFileEnumerator> localFileEnumerator, bool shouldUpdateFileIDInStrata)
    : observer_(std::move(observer)),
      localFileEnumerator_(std::move(localFileEnumerator)),
      shouldUpdateFileIDInStrata_(shouldUpdateFileIDInStrata) {}

void LocalChangesObserverContext::setFSChangesEnumerator(
    std::weak_ptr<FSChangesEnumerator> enumerator) {
    fsChangesEnumerator_ = std::move(enumerator);
}

void LocalChangesObserverContext::didUpdateItems(const std::vector<HostPorterItemRef>& items) {
    if (shouldUpdateFileIDInStrata_) {
        for (const auto& item : items) {
            {
                MutexLock lock(mutex_);
                if (item == lastLookedUp_)
                    continue;
                lastLookedUp_ = item;
            }
            updateFileIDInStrata(item);
        }
    }
    observer_->didUpdateItems(items);
}

void LocalChangesObserverContext::didDeleteItemsWithIdentifiers(
    const std::vector<HostPorterItemIdentifier>& identifiers) {
    observer_->didDeleteItemsWithIdentifiers(identifiers);
}

void LocalChangesObserverContext::finishEnumeratingChangesUpToSyncAnchor(
    const HostPorterSyncAnchor& anchor, bool moreComing) {
    observer_->finishEnumeratingChangesUpToSyncAnchor(anchor, moreComing);
    endChangeEnumerator();
}

void LocalChangesObserverContext::finishEnumeratingWithError(const Error& error) {
    observer_->finishEnumeratingWithError(error);
    endChangeEnumerator();
}

void LocalChangesObserverContext::endChangeEnumerator() {
    if (FSChangesEnumeratorRef enumerator = fsChangesEnumerator_.lock())
        localFileEnumerator_->removeEnumerator(enumerator);
    fsChangesEnumerator_.reset();
}

}  // namespace tamber
