#include "fs/FSChangesEnumerator.h"

#include <algorithm>
#include <limits>

#include "applibraries/LocalAppLibraryManager.h"
#include "fs/ChangePageResumes.h"
#include "host/ItemIdentifier.h"
#include "host/UrlOperations.h"
#include "items/LocalAppLibraryItem.h"
#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

std::shared_ptr<FSChangesEnumerator> FSChangesEnumerator::make(
    FSChangeToken token, HostPorterItemIdentifier container, std::vector<Url> urls,
    std::shared_ptr<HostPorterChangeObserver> observer) {
    if (urls.empty())
        fatalError("require at least one URL to init a change enumerator");
    auto enumerator = std::make_shared<FSChangesEnumerator>(
        Private{}, std::move(token), std::move(container), std::move(urls), std::move(observer));
    enumerator->currentReader()->setDelegate(enumerator);
    return enumerator;
}

FSChangesEnumerator::FSChangesEnumerator(Private, FSChangeToken token,
                                         HostPorterItemIdentifier container, std::vector<Url> urls,
                                         std::shared_ptr<HostPorterChangeObserver> observer)
    : currentToken_(std::move(token)),
      container_(std::move(container)),
      urls_(std::move(urls)),
      observer_(std::move(observer)),
      sinceTremorID_(currentToken_.streamEventID),
      maxTremorID_(currentToken_.streamEventID) {
    if (urls_.empty())
        fatalError("require at least one URL to init a change enumerator");
    if (currentToken_.offset > 0) {
        // The page before this one stopped at a known event: go on from there, as replaying
        // the history from the anchor and skipping `offset` changes would, without building
        // the skipped ones again.
        auto point = ChangePageResumes::shared().take(
            ChangePageResumes::keyFor(currentToken_, container_, urls_));
        if (point) {
            numberOfChanges_ = currentToken_.offset;
            maxTremorID_ = std::max(maxTremorID_, point->maxTremorID);
            shouldProcessedTremorsDocIDBased_ = point->mode == TremorReaderMode::pathBased;
            reader_ = TremorReader::make(urls_, point->eventID, point->mode, true);
            return;
        }
    }
    reader_ = TremorReader::make(urls_, sinceTremorID_, TremorReaderMode::pathBased, true);
}

void FSChangesEnumerator::start() {
    if (auto reader = currentReader())
        reader->start();
}

void FSChangesEnumerator::stop() {
    if (auto reader = currentReader())
        reader->stop();
}

TremorReaderRef FSChangesEnumerator::currentReader() const {
    MutexLock lock(mutex_);
    return reader_;
}

void FSChangesEnumerator::stopAsync(TremorReader& reader) {
    // Reports run inside the reader's callback: the stop must wait until it has returned, and
    // the rest of the batch is not wanted.
    reader.stopAfterCurrentEvent();
    reader.streamQueue()->async([self = reader.shared_from_this()] { self->stop(); });
}

bool FSChangesEnumerator::accepts(const TremorReader& reader) const {
    reader.streamQueue()->assertCurrent();
    MutexLock lock(mutex_);
    // A stopped pass may still finish the batch it was in; that is not news any more.
    return !finished_ && &reader == reader_.get();
}

bool FSChangesEnumerator::pageIsFull() const {
    return numberOfChanges_ >= currentToken_.offset &&
           numberOfChanges_ - currentToken_.offset == kPageSize;
}

FSChangesEnumerator::Passage FSChangesEnumerator::pass() {
    MutexLock lock(mutex_);
    Passage passage;
    if (finished_)
        return passage;
    if (numberOfChanges_ == std::numeric_limits<uint64_t>::max())
        fatalError("too many changes for one change enumeration");
    ++numberOfChanges_;
    // Changes up to the anchor's offset went out with an earlier page of the same history.
    passage.send = numberOfChanges_ > currentToken_.offset;
    if (pageIsFull()) {
        // The event ID stays the anchor's: the next request replays the same history and
        // skips what this one sent.
        finished_ = true;
        currentToken_.offset = numberOfChanges_;
        passage.pageAnchor = currentToken_.encode();
        passage.reader = reader_;
        // A change made by the event in progress (not by a later check of it) marks where the
        // next page may start.
        uint64_t eventID = reader_->eventInProgress();
        if (eventID != 0 && deferredChecks_ == 0) {
            ChangePageResumes::shared().keep(
                ChangePageResumes::keyFor(currentToken_, container_, urls_),
                {reader_->mode(), eventID, maxTremorID_});
        }
    }
    return passage;
}

void FSChangesEnumerator::forwardUpdate(const LocalItemRef& item, const std::optional<Url>& url) {
    Passage passage = pass();
    if (passage.send) {
        logDebug([&] {
            return "forward update of " + item->description() +
                   (url ? " to " + url->path() : std::string());
        });
        observer_->didUpdateItems({item});
    }
    if (passage.pageAnchor) {
        stopAsync(*passage.reader);
        observer_->finishEnumeratingChangesUpToSyncAnchor(*passage.pageAnchor, true);
    }
}

void FSChangesEnumerator::forwardDeletion(const HostPorterItemIdentifier& identifier) {
    Passage passage = pass();
    if (passage.send) {
        logDebug([&] { return "forward deletion of " + identifier; });
        observer_->didDeleteItemsWithIdentifiers({identifier});
    }
    if (passage.pageAnchor) {
        stopAsync(*passage.reader);
        observer_->finishEnumeratingChangesUpToSyncAnchor(*passage.pageAnchor, true);
    }
}

void FSChangesEnumerator::readerDidChange(TremorReader& reader, const LocalItemRef& item,
                                          const std::optional<Url>& url) {
    if (!accepts(reader))
        return;
    if (container_ == HostPorterAllDirectoriesContainerItemIdentifier && !item->isFolder()) {
        logDebug([&] {
            return "ignore update of " + item->description() + "; item is not a directory of " +
                   container_;
        });
        return;
    }
    forwardUpdate(item, url);
}

void FSChangesEnumerator::readerDidDelete(TremorReader& reader,
                                          const HostPorterItemIdentifier& identifier,
                                          const std::optional<Url>& url) {
    if (!accepts(reader))
        return;
    auto parsed = ItemIdentifier::parse(identifier);
    bool isLibrary = parsed.isAppLibrary();
    if (container_ == HostPorterWorkingSetContainerItemIdentifier) {
        if (isLibrary) {
            logDebug(
                [&] { return "ignore update of " + identifier + "; app library are not indexed"; });
            return;
        }
    } else if (container_ == HostPorterAllDirectoriesContainerItemIdentifier) {
        if (parsed.kind() != ItemIdentifier::Kind::File) {
            logDebug(
                [&] { return "ignore update of " + identifier + "; item is not a directory"; });
            return;
        }
    } else if (container_ == HostPorterRootContainerItemIdentifier) {
        forwardDeletion(identifier);
        if (url && !isLibrary) {
            // The folder that vanished may have been an app's library root, which the root
            // container shows as the library itself.
            {
                MutexLock lock(mutex_);
                ++deferredChecks_;
            }
            reader.streamQueue()->async(
                [self = shared_from_this(), url = *url] { self->reportLibraryRootDeletion(url); });
        }
        return;
    }
    forwardDeletion(identifier);
}

void FSChangesEnumerator::reportLibraryRootDeletion(const Url& url) {
    {
        MutexLock lock(mutex_);
        if (finished_ || pageIsFull())
            return;
    }
    auto record = LocalAppLibraryManager::shared()->bundleProxyFor(url, UrlRelationship::Same);
    if (!record)
        return;
    forwardDeletion(appLibraryIdentifier(*record));
}

void FSChangesEnumerator::readerDidProcessHistory(TremorReader& reader) {
    if (!accepts(reader))
        return;
    stopAsync(reader);
    MutexLock lock(mutex_);
    if (shouldProcessedTremorsDocIDBased_) {
        // The path-based pass saw every path event up to the end of its history. The
        // document-ID pass starts later and may read further; the anchor stays here, or the
        // path events journaled in between would be skipped. Document-ID events past here are
        // sent again by the next request, which a host takes in its stride.
        maxTremorID_ =
            std::max({maxTremorID_, reader.lastProcessedTremorID(), reader.historyEndTremorID()});
        logDebug("processed all Tremors path based, carry on with the docID based");
        shouldProcessedTremorsDocIDBased_ = false;
        auto next = TremorReader::make(urls_, sinceTremorID_, TremorReaderMode::docIDBased, true);
        next->setDelegate(weak_from_this());
        reader_ = next;
        lock.unlock();
        // Started from this pass's queue, behind the checks of vanished folders this pass
        // queued there: the second pass could otherwise catch up and close the request before
        // a library root's deletion was counted.
        reader.streamQueue()->async([self = shared_from_this(), next] {
            {
                MutexLock lock(self->mutex_);
                if (self->finished_)
                    return;  // one of those checks filled the page
            }
            next->start();
        });
        return;
    }
    logDebug("fetching changes did catch up");
    finished_ = true;
    currentToken_.streamEventID = maxTremorID_;
    currentToken_.offset = 0;
    HostPorterSyncAnchor anchor = currentToken_.encode();
    lock.unlock();
    observer_->finishEnumeratingChangesUpToSyncAnchor(anchor, false);
}

void FSChangesEnumerator::readerMustRescan(TremorReader& reader) {
    if (!accepts(reader))
        return;
    stopAsync(reader);
    {
        MutexLock lock(mutex_);
        finished_ = true;
    }
    logDebug("fetching changes did finish after reset");
    observer_->finishEnumeratingWithError(Error::syncAnchorExpired());
}

void FSChangesEnumerator::readerDidFinishBatch(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
}

}  // namespace tamber
