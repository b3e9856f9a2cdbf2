#include "provider/LocalPorter.h"

#include "host/HostPorterManager.h"
#include "host/ItemIdentifier.h"
#include "host/PublishedTrees.h"
#include "items/AppLibraryLookup.h"
#include "items/LocalAppLibraryItem.h"
#include "items/TBFileObjectIdentifier.h"
#include "items/TBPFileObjectIdentifier.h"
#include "platform/FileContents.h"
#include "platform/apps/BundleRecord.h"
#include "provider/LocalPorterError.h"
#include "provider/TrashLocations.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

bool isAppLibraryRoot(const Url& url) {
    auto lookup = AppLibraryLookup::current();
    return lookup && lookup->bundleIdentifierForRoot(url, UrlRelationship::Same).has_value();
}

constexpr double kAppRefreshMinimumInterval = 0.5;
const char* const kTemporaryLocalFolderName = ".TemporaryLocalFolder";

bool isAppLibraryIdentifier(const HostPorterItemIdentifier& identifier) {
    return ItemIdentifier::parse(identifier).isAppLibrary();
}

}  // namespace

LocalPorter::LocalPorter(ProviderServices services)
    : services_(std::move(services)),
      appRefreshQueue_(DispatchQueue::makeSerial("tamber.app-refresh.queue")),
      appRefreshPacer_(std::make_unique<Pacer>("tamber.app-refresh.pacer", appRefreshQueue_,
                                               kAppRefreshMinimumInterval)) {}

std::shared_ptr<LocalPorter> LocalPorter::create() {
    return create(ProviderServices::fromCurrentSlots());
}

std::shared_ptr<LocalPorter> LocalPorter::create(ProviderServices services) {
    auto porter = std::make_shared<LocalPorter>(std::move(services));
    porter->installPacerHandler();
    installPutBackResolver();
    // The host may hold a working set from an earlier run: have it ask what changed since.
    logInfo("auto notify changes on HostPorterWorkingSetContainerItemIdentifier at startup");
    porter->services_.manager->signalEnumeratorForContainerItemIdentifier(
        HostPorterWorkingSetContainerItemIdentifier, [](std::optional<Error>) {});
    return porter;
}

void LocalPorter::installPacerHandler() {
    std::weak_ptr<LocalPorter> weak = weak_from_this();
    appRefreshPacer_->setEventHandler([weak] {
        auto porter = weak.lock();
        if (!porter)
            return;
        withLogSection("pacer event", [&] { porter->refreshAppLibraries(); });
    });
}

// MARK: lookups

LocalPorter::LocalItemRef LocalPorter::temporaryLocalFolderItem() {
    Url url =
        services_.manager->documentStorageURL().appendingPathComponent(kTemporaryLocalFolderName);
    if (auto status = FileContents::createDirectory(url); !status.ok()) {
        logError("can't create temporary directory; " + status.error().description());
        return nullptr;
    }
    return LocalItem::make(url);
}

LocalPorter::LocalItemRef LocalPorter::itemFromIdentifier(
    const HostPorterItemIdentifier& identifier) {
    if (isAppLibraryIdentifier(identifier)) {
        auto record = BundleRecord::bundleRecordWithBundleIdentifier(identifier.substr(1));
        if (!record)
            return nullptr;
        return LocalAppLibraryItem::initFrom(record);
    }
    if (identifier == HostPorterTemporaryLocalFolderItemIdentifier)
        return temporaryLocalFolderItem();
    auto url = TBFileObjectIdentifier::fileURLWithItemIdentifier(identifier);
    if (!url)
        return nullptr;
    return LocalItem::make(*url);
}

Result<Url> LocalPorter::urlForIdentifier(const HostPorterItemIdentifier& identifier) {
    auto item = itemFromIdentifier(identifier);
    if (!item)
        return Error::porterErrorForNonExistentItemWithIdentifier(identifier);
    const Url& url = item->fileURL();
    logDebug([&] { return "found " + url.absoluteString(); });
    return url;
}

Result<Url> LocalPorter::urlForIdentifierLogged(const HostPorterItemIdentifier& identifier) {
    return withLogSection("fetching URL for \"" + identifier + "\"",
                          [&] { return urlForIdentifier(identifier); });
}

std::optional<Url> LocalPorter::_urlForItemWithPersistentIdentifier(
    const HostPorterItemIdentifier& identifier) {
    auto url = urlForIdentifierLogged(identifier);
    if (!url.ok()) {
        logError("can't find URL matching identifier " + identifier + "; " +
                 std::to_string(url.error().code()));
        return std::nullopt;
    }
    return url.value();
}

std::optional<Url> LocalPorter::URLForItemWithPersistentIdentifier(
    const HostPorterItemIdentifier& identifier) {
    return _urlForItemWithPersistentIdentifier(identifier);
}

std::optional<HostPorterItemIdentifier> LocalPorter::identifierForURL(const Url& url) {
    // An app's library is named by its app. On Linux the document storage itself (~/Documents)
    // and any user folder may be named "Documents" too: those are ordinary items, not missing
    // libraries.
    if (url.lastPathComponent() == "Documents" && isAppLibraryRoot(url))
        return TBPFileObjectIdentifier::fromAppLibraryDataContainerURL(url);
    auto item = LocalItem::make(url);
    if (!item)
        return std::nullopt;
    HostPorterItemIdentifier identifier = item->itemIdentifier();
    logDebug([&] { return "found " + identifier; });
    return identifier;
}

std::optional<HostPorterItemIdentifier> LocalPorter::identifierForURLLogged(const Url& url) {
    return withLogSection("fetching item identifier for \"" + url.path() + "\"",
                          [&] { return identifierForURL(url); });
}

std::optional<HostPorterItemIdentifier> LocalPorter::_persistentIdentifierForItemAt(
    const Url& url) {
    return identifierForURLLogged(url);
}

std::optional<HostPorterItemIdentifier> LocalPorter::persistentIdentifierForItemAtURL(
    const Url& url) {
    return _persistentIdentifierForItemAt(url);
}

Result<LocalPorter::LocalItemRef> LocalPorter::itemForIdentifierUnlogged(
    const HostPorterItemIdentifier& identifier) {
    auto item = itemFromIdentifier(identifier);
    if (!item) {
        logError("item lookup failed for identifier \"" + identifier + "\"");
        return makeLocalPorterError(LocalPorterError::invalidItemIdentifier, identifier);
    }
    logDebug([&] { return "found " + item->description(); });
    return item;
}

Result<LocalPorter::LocalItemRef> LocalPorter::itemForIdentifierLogged(
    const HostPorterItemIdentifier& identifier) {
    return withLogSection("fetching item's properties for \"" + identifier + "\"",
                          [&] { return itemForIdentifierUnlogged(identifier); });
}

Result<HostPorterItemRef> LocalPorter::itemForIdentifier(
    const HostPorterItemIdentifier& identifier) {
    auto item = itemForIdentifierLogged(identifier);
    if (!item.ok())
        return item.error();
    return HostPorterItemRef(item.value());
}

Result<HostPorterItemRef> LocalPorter::itemAtURL(const Url& url) {
    return itemForURL(url);
}

void LocalPorter::finishWithItem(const Result<Url>& changed, const ChangeUndo& undo,
                                 const ItemCompletion& completion) {
    if (!changed.ok())
        return completion(changed.error());
    auto item = itemForURL(changed.value());
    if (item.ok())
        return completion(item.value());
    Error error = item.error();
    undo(changed.value(), [completion, error] { completion(error); });
}

Result<LocalPorter::LocalItemRef> LocalPorter::itemForURL(const Url& url) {
    if (auto outside = PublishedTrees::check(url); !outside.ok()) {
        logDebug([&] { return "\"" + url.path() + "\" is " + PublishedTrees::kOutsideMessage; });
        return outside.error();
    }
    auto identifier = identifierForURLLogged(url);
    if (!identifier) {
        logError("identifier lookup failed for URL \"" + url.path() + "\"");
        return makeLocalPorterError(LocalPorterError::invalidItemIdentifier, url.path());
    }
    if (isAppLibraryIdentifier(*identifier) ||
        *identifier == HostPorterTemporaryLocalFolderItemIdentifier)
        return itemForIdentifierLogged(*identifier);
    auto item = LocalItem::make(url);
    if (!item) {
        logError("can't create item for URL \"" + url.path() + "\"");
        return makeLocalPorterError(LocalPorterError::invalidItemIdentifier, url.path());
    }
    return item;
}

// MARK: files are local

void LocalPorter::providePlaceholderAtURL(const Url&,
                                          std::function<void(std::optional<Error>)> completion) {
    completion(std::nullopt);
}

void LocalPorter::startProvidingItemAtURL(const Url&,
                                          std::function<void(std::optional<Error>)> completion) {
    completion(std::nullopt);
}

void LocalPorter::itemChangedAtURL(const Url&) {}

void LocalPorter::stopProvidingItemAtURL(const Url&) {}

}  // namespace tamber
