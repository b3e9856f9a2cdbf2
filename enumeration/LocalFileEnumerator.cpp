#include "enumeration/LocalFileEnumerator.h"

#include "enumeration/FSDirectoryEnumerator.h"
#include "enumeration/LocalChangesObserverContext.h"
#include "host/PublishedTrees.h"
#include "items/LocalItem.h"
#include "items/TBFileObjectIdentifier.h"
#include "support/Log.h"
#include "support/LogSection.h"
#include "support/MutexLock.h"

namespace tamber {

namespace {

// The provider's "unableToGetDeviceUUID" failure. The provider layer owns that error type, above
// this one; the value (domain and code) is the same.
constexpr const char* kProviderErrorDomain = "LocalPorter.Error";
constexpr int64_t kUnableToGetDeviceUUID = 3;

Error unableToGetDeviceUUIDError() {
    return Error(
        kProviderErrorDomain, kUnableToGetDeviceUUID,
        {{"description", "can't identify the volume (its event journal has no identifier)"},
         {"case", "unableToGetDeviceUUID"}});
}

std::string describePaths(const std::vector<Url>& urls) {
    std::string text = "[";
    for (size_t i = 0; i < urls.size(); ++i) {
        if (i > 0)
            text += ", ";
        text += urls[i].path();
    }
    return text + "]";
}

// Only the top level of a trash is listed: what lies deeper went to the trash with its folder.
std::optional<DirectoryEnumerationOptions> trashOverride(const Url& root) {
    if (root.lastPathComponent() == ".Trash") {
        return DirectoryEnumerationOption::kSkipsHiddenFiles |
               DirectoryEnumerationOption::kSkipsPackageDescendants |
               DirectoryEnumerationOption::kSkipsSubdirectoryDescendants;
    }
    return std::nullopt;
}

}  // namespace

std::shared_ptr<LocalFileEnumerator> LocalFileEnumerator::initWithContainer(
    HostPorterItemIdentifier container, std::vector<Url> urls) {
    if (urls.empty())
        fatalError("can't create enumerator for an empty list of URLs");
    return std::make_shared<LocalFileEnumerator>(Private{}, std::move(container), std::move(urls));
}

LocalFileEnumerator::LocalFileEnumerator(Private, HostPorterItemIdentifier container,
                                         std::vector<Url> urls)
    : container_(std::move(container)),
      // A folder has one URL; the root's list ends with the document storage, whose direct
      // children are the root's files.
      enumeratedItemURL_(urls.back()),
      urls_(std::move(urls)) {
    notifier_ = FSChangesNotifier::make(container_, urls_);
    if (!notifier_) {
        logError("can't create notifier for \"" + container_ +
                 "\"; enumeration will have no live update");
    }
}

LocalFileEnumerator::~LocalFileEnumerator() {
    // A reader must not outlive its stream unstopped.
    if (notifier_ && notifierStarted_)
        notifier_->stop();
}

bool LocalFileEnumerator::shouldUpdateFileIDInStrata() const {
    // Every updated item is looked up in the document-ID index before it is reported, so that
    // a file saved just before is known there when the host asks for it by identifier. It is
    // a read (nothing is allocated) and cheap next to building the item record.
    return true;
}

size_t LocalFileEnumerator::runningEnumeratorCount() const {
    MutexLock lock(mutex_);
    return enumerators_.size();
}

std::vector<Url> LocalFileEnumerator::listedRoots() const {
    if (container_ == HostPorterAllDirectoriesContainerItemIdentifier)
        return urls_;
    if (container_ == HostPorterWorkingSetContainerItemIdentifier) {
        // Trash folders are hidden, so walking a root never reaches its trash: the working set
        // adds each one, after all the roots.
        std::vector<Url> roots = urls_;
        for (const Url& url : urls_) roots.push_back(url.appendingPathComponent(".Trash"));
        return roots;
    }
    return {enumeratedItemURL_};
}

bool LocalFileEnumerator::listsRecursively() const {
    return container_ == HostPorterAllDirectoriesContainerItemIdentifier ||
           container_ == HostPorterWorkingSetContainerItemIdentifier;
}

void LocalFileEnumerator::enumerateItemsForObserver(
    std::shared_ptr<HostPorterEnumerationObserver> observer, const HostPorterPage& page) {
    std::optional<FSChangeToken> token;
    std::string pageDescription;
    if (page == HostPorterInitialPageSortedByDate()) {
        pageDescription = "initialPageSortedByDate";
    } else if (page == HostPorterInitialPageSortedByName()) {
        pageDescription = "initialPageSortedByName";
    } else {
        token = FSChangeToken::decode(page);
        if (!token) {
            logError("can't create change token from anchor data, resetting");
            observer->finishEnumeratingWithError(Error::syncAnchorExpired());
            return;
        }
        pageDescription = token->description();
    }
    withLogSection("enumerate items for " + container_ + " with page " + pageDescription,
                   [&] { gatherPhase(*observer, token); });
}

void LocalFileEnumerator::gatherPhase(HostPorterEnumerationObserver& observer,
                                      const std::optional<FSChangeToken>& token) {
    const Url& volumeURL = urls_.front();
    std::optional<std::string> deviceUUID = TremorReader::deviceUUID(volumeURL);
    if (!deviceUUID) {
        logError("can't get volume UUID for " + volumeURL.path());
        observer.finishEnumeratingWithError(unableToGetDeviceUUIDError());
        return;
    }

    uint64_t startEventID;
    uint64_t startOffset;
    if (!token) {
        logDebug("start gather phase");
        startEventID = TremorReader::currentEventID();
        startOffset = 0;
    } else {
        if (token->deviceUUID != *deviceUUID) {
            logDebug("device UUID changed (" + token->deviceUUID + " -> " + *deviceUUID + ")");
            observer.finishEnumeratingWithError(Error::syncAnchorExpired());
            return;
        }
        logDebug([&] { return "resume gather phase at offset " + std::to_string(token->offset); });
        // The trees themselves are replayed: a trash lies inside its root.
        std::vector<Url> replayed = listsRecursively() ? urls_ : std::vector{enumeratedItemURL_};
        auto [status, currentEventID] =
            TremorReader::canResumeGatherPhase(replayed, token->streamEventID);
        (void)currentEventID;
        using Kind = TremorReaderGatherPhaseResumeStatus::Kind;
        if (status.kind == Kind::deletionOccurred) {
            logDebug("deletion of " + status.deletion + " requires to re-gather from scratch");
            observer.finishEnumeratingWithError(Error::syncAnchorExpired());
            return;
        }
        if (status.kind == Kind::cantReplayHistoricalTremors) {
            logDebug("can't replay historical Tremors, need to re-start gather phase from scratch");
            observer.finishEnumeratingWithError(Error::syncAnchorExpired());
            return;
        }
        logDebug([&] {
            return "safe to resume gather phase from " + std::to_string(token->streamEventID);
        });
        startEventID = token->streamEventID;
        startOffset = token->offset;
    }

    FSDirectoryEnumerator walk;
    walk.urls = listedRoots();
    walk.recursively = listsRecursively();
    walk.offset = startOffset;
    walk.limit = kPageSize;
    // A folder that can't be read at all fails its page: an empty page would say it is empty.
    // (The roots of the working set and all-directories may be missing; those go on.)
    std::optional<Error> unreadable;
    const bool onlyTheFolder = !listsRecursively();
    walk.errorHandler = [&](const Url& url, const Error& error) {
        if (onlyTheFolder && url == enumeratedItemURL_ && !unreadable)
            unreadable = error;
        return FSDirectoryEnumerator::logEnumerationError(url, error);
    };
    walk.directoryEnumerationOptionsFor = &trashOverride;
    // The page's folders stay open while its records are built: their entries are read
    // relative to them.
    std::vector<OpenFolderRef> openFolders;
    std::vector<Url> urls;
    urls.reserve(kPageSize);
    uint64_t newOffset = walk.enumerate([&](const Url& url) { urls.push_back(url); }, &openFolders);
    // The page's documents get their IDs together: one index read, and one transaction for
    // those that have none yet.
    PublishedTrees::CheckedFolders checkedFolders;
    TBFileObjectIdentifier::prepareItemIdentifiers(urls);
    std::vector<HostPorterItemRef> items = makeItems(urls);
    openFolders.clear();

    if (unreadable) {
        std::map<std::string, std::string> info = unreadable->userInfo();
        info["description"] =
            "can't list " + enumeratedItemURL_.path() + ": " + unreadable->reason();
        observer.finishEnumeratingWithError(PublishedTrees::unmarked(
            Error(unreadable->domain(), unreadable->code(), std::move(info))));
        return;
    }
    logDebug([&] { return "discovered " + std::to_string(items.size()) + " items"; });
    observer.didEnumerateItems(items);

    FSChangeToken next{0, *deviceUUID, startEventID, newOffset, 0};
    if (newOffset < startOffset) {
        logError("enumerator returned an offset (" + std::to_string(newOffset) +
                 ") smaller than the initial offset " + std::to_string(startOffset));
        observer.finishEnumeratingWithError(Error::syncAnchorExpired());
    } else if (newOffset - startOffset != kPageSize) {
        logDebug([&] { return "gather phase finished for " + describePaths(walk.urls); });
        observer.finishEnumeratingUpToPage(std::nullopt);
    } else {
        observer.finishEnumeratingUpToPage(next.encode());
    }
}

std::vector<HostPorterItemRef> LocalFileEnumerator::makeItems(const std::vector<Url>& urls) {
    std::vector<HostPorterItemRef> items;
    items.reserve(urls.size());
    // A page's entries mostly share a few folders: each folder's identifier is found once.
    std::string parentPath;
    std::optional<HostPorterItemIdentifier> parentID;
    for (const Url& url : urls) {
        std::string_view path = url.path();
        std::string_view parent = path.substr(0, path.rfind('/'));
        if (parentPath.empty() || parent != parentPath) {
            parentPath = parent;
            parentID = LocalItem::parentItemIdentifierOf(url);
        }
        LocalItemOptions options;
        options.customParentItemID = parentID;
        // A file that can't become a record (vanished, no identifier) was logged by make().
        if (LocalItemRef item = LocalItem::make(url, options))
            items.push_back(std::move(item));
    }
    return items;
}

void LocalFileEnumerator::enumerateChangesForObserver(
    std::shared_ptr<HostPorterChangeObserver> observer, const HostPorterSyncAnchor& anchor) {
    std::optional<FSChangeToken> token = FSChangeToken::decode(anchor);
    if (!token) {
        logError("can't create change token from anchor data, resetting");
        observer->finishEnumeratingWithError(Error::syncAnchorExpired());
        return;
    }
    enumerateChangesForObserver(std::move(observer), *token);
}

void LocalFileEnumerator::enumerateChangesForObserver(
    std::shared_ptr<HostPorterChangeObserver> observer, const FSChangeToken& token) {
    withLogSection(
        "enumerate changes for " + container_ + " with token " + token.description(), [&] {
            const Url& volumeURL = urls_.front();
            std::optional<std::string> deviceUUID = TremorReader::deviceUUID(volumeURL);
            if (!deviceUUID) {
                logError("can't get volume UUID for " + volumeURL.path());
                observer->finishEnumeratingWithError(unableToGetDeviceUUIDError());
                return;
            }
            if (token.deviceUUID != *deviceUUID) {
                logDebug("device UUID changed (" + token.deviceUUID + " -> " + *deviceUUID + ")");
                observer->finishEnumeratingWithError(Error::syncAnchorExpired());
                return;
            }
            auto context = std::make_shared<LocalChangesObserverContext>(
                observer, shared_from_this(), shouldUpdateFileIDInStrata());
            FSChangesEnumeratorRef enumerator =
                FSChangesEnumerator::make(token, container_, urls_, context);
            context->setFSChangesEnumerator(enumerator);
            {
                // In the set before it starts: a quick finish on the reader's queue removes
                // it, and must find it there.
                MutexLock lock(mutex_);
                enumerators_.insert(enumerator);
            }
            enumerator->start();
        });
}

void LocalFileEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<HostPorterSyncAnchor>)> completion) {
    if (!notifier_) {
        completion(std::nullopt);
        return;
    }
    FSChangeToken token{0, notifier_->deviceUUID(), TremorReader::currentEventID(), 0, 0};
    completion(token.encode());
}

void LocalFileEnumerator::removeEnumerator(const FSChangesEnumeratorRef& enumerator) {
    MutexLock lock(mutex_);
    enumerators_.erase(enumerator);
}

void LocalFileEnumerator::start() {
    MutexLock lock(mutex_);
    if (!notifier_ || notifierStarted_)
        return;
    notifierStarted_ = true;
    notifier_->start();
}

void LocalFileEnumerator::stop() {
    MutexLock lock(mutex_);
    if (!notifier_ || !notifierStarted_)
        return;
    notifierStarted_ = false;
    notifier_->stop();
}

void LocalFileEnumerator::invalidate() {
    stop();
    std::set<FSChangesEnumeratorRef> running;
    {
        MutexLock lock(mutex_);
        // Dropping them also breaks the loop each forms with its observer context, which
        // holds this enumerator until the change enumeration finishes.
        running.swap(enumerators_);
    }
    for (const auto& enumerator : running) enumerator->stop();
}

}  // namespace tamber
