#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterExtension.h"
#include "items/ItemMetadata.h"
#include "items/LocalItem.h"
#include "platform/apps/AppRecord.h"
#include "provider/ChangeUndo.h"
#include "provider/ProviderServices.h"
#include "support/DispatchQueue.h"
#include "support/Pacer.h"
#include "support/Result.h"

namespace tamber {

// The provider: answers the host's questions about items and owns the app-refresh state. Every
// lookup builds fresh records from the file system; nothing is cached per identifier.
class LocalPorter : public HostPorterExtension, public std::enable_shared_from_this<LocalPorter> {
public:
    using LocalItemRef = std::shared_ptr<const LocalItem>;

    // Use `create`: the pacer's handler needs a weak reference to the provider.
    explicit LocalPorter(ProviderServices services);
    // Without services, the process's current manager and file system.
    static std::shared_ptr<LocalPorter> create();
    static std::shared_ptr<LocalPorter> create(ProviderServices services);

    const ProviderServices& services() const { return services_; }

    const std::shared_ptr<DispatchQueue>& appRefreshQueue() const { return appRefreshQueue_; }

    // Host-facing.
    Result<HostPorterItemRef> itemForIdentifier(
        const HostPorterItemIdentifier& identifier) override;
    std::optional<Url> URLForItemWithPersistentIdentifier(
        const HostPorterItemIdentifier& identifier) override;
    std::optional<HostPorterItemIdentifier> persistentIdentifierForItemAtURL(
        const Url& url) override;
    std::optional<Url> _urlForItemWithPersistentIdentifier(
        const HostPorterItemIdentifier& identifier);
    std::optional<HostPorterItemIdentifier> _persistentIdentifierForItemAt(const Url& url);
    void providePlaceholderAtURL(const Url& url,
                                 std::function<void(std::optional<Error>)> completion) override;
    void startProvidingItemAtURL(const Url& url,
                                 std::function<void(std::optional<Error>)> completion) override;
    void itemChangedAtURL(const Url& url) override;
    void stopProvidingItemAtURL(const Url& url) override;

    // The lookups the provider's operations share.
    LocalItemRef itemFromIdentifier(const HostPorterItemIdentifier& identifier);
    Result<Url> urlForIdentifierLogged(const HostPorterItemIdentifier& identifier);
    std::optional<HostPorterItemIdentifier> identifierForURLLogged(const Url& url);
    Result<LocalItemRef> itemForIdentifierLogged(const HostPorterItemIdentifier& identifier);
    Result<LocalItemRef> itemForURL(const Url& url);
    // Completes an item operation with the item at `changed`; when its record cannot be read,
    // `undo` reverses the change first and the completion gets the error.
    void finishWithItem(const Result<Url>& changed, const ChangeUndo& undo,
                        const ItemCompletion& completion);

    // Enumerators: the root enumerator for the three root-served containers, a folder
    // enumerator for any other container; either is started before it is returned.
    Result<HostPorterEnumeratorRef> enumeratorForContainerItemIdentifier(
        const HostPorterItemIdentifier& identifier) override;

    // The item at a path: the item-for-URL lookup below, for hosts.
    Result<HostPorterItemRef> itemAtURL(const Url& url) override;

    // Item operations. Every completion is called exactly once, on whatever thread the file
    // operation finishes; the item is always a LocalItem.
    void importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                             ItemCompletion completion) override;
    void createDirectoryWithName(const std::string& name, const HostPorterItemIdentifier& parent,
                                 ItemCompletion completion) override;
    void createDirectoryWithName(const std::string& name, const HostPorterItemIdentifier& parent,
                                 bool bounce, ItemCompletion completion) override;
    void renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                  const std::string& name, ItemCompletion completion) override;
    void reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                    const HostPorterItemIdentifier& parent,
                                    const std::optional<std::string>& newName,
                                    ItemCompletion completion) override;
    void deleteItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                  ErrorCompletion completion) override;

    // Trash and put-back.
    void trashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                 ItemCompletion completion) override;
    void untrashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                   const std::optional<HostPorterItemIdentifier>& parent,
                                   ItemCompletion completion) override;
    // Removes what was trashed before `referenceDate`, stamps what has no trash date; the
    // completion runs on "tamber.auto-delete.notifier" once every deletion has finished.
    void _removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                          std::function<void()> completion);
    // The same sweep for hosts, reporting how many deletions succeeded.
    void removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                         std::function<void(size_t removed)> completion) override;

    // Metadata.
    void setLastUsedDate(std::shared_ptr<const Date> date,
                         const HostPorterItemIdentifier& identifier,
                         ItemCompletion completion) override;
    void setTagData(const std::optional<Bytes>& tagData, const HostPorterItemIdentifier& identifier,
                    ItemCompletion completion) override;
    void setFavoriteRank(std::shared_ptr<const Number> rank,
                         const HostPorterItemIdentifier& identifier,
                         ItemCompletion completion) override;

    // Thumbnails: only app libraries have one, their app's icon as PNG.
    void fetchThumbnailsForItemIdentifiers(const std::vector<HostPorterItemIdentifier>& identifiers,
                                           ThumbnailSize requestedSize,
                                           PerThumbnailCompletion perThumbnailCompletion,
                                           ErrorCompletion completion) override;
    void fetchThumbnailsForItemIdentifiers(const std::vector<HostPorterItemIdentifier>& identifiers,
                                           ThumbnailSize requestedSize,
                                           PerThumbnailCompletionWithType perThumbnailCompletion,
                                           ErrorCompletion completion) override;
    std::optional<Bytes> bestIconData(const AppRecord& record);

    // The app library item of one app; the public name forwards to the underscored one.
    void _defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                         ItemCompletion completion);
    void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                        ItemCompletion completion) override;

    // Refreshes the app libraries from the registry, upgrades the shared manager from the main
    // cache, calls the waiting handlers and signals the containers that changed. Runs on the
    // caller's thread; the pacer runs it on the app-refresh queue.
    struct AppRefreshOutcome {
        bool rootChanged = false;
        bool workingSetChanged = false;
    };
    AppRefreshOutcome refreshAppLibraries();
    // Coalesced through the pacer; `completion` is called after the next refresh (and again
    // after every later one).
    void _refreshInstalledAppsWithCompletionHandler(std::function<void()> completion);
    void refreshInstalledAppsWithCompletionHandler(std::function<void()> completion) override;

    // Metadata by path, for hosts that name an item by its path rather than its identifier
    // (the command line's meta verb). Works without the journal or the app refresh: the item
    // only has to lie in a published tree.
    struct MetadataChanges {
        // Each one present is written; a null rank or date removes that attribute.
        std::optional<std::shared_ptr<const Number>> favoriteRank;
        std::optional<std::shared_ptr<const Date>> lastUsedDate;
        std::optional<Bytes> tagData;
    };
    // Writes the favourite rank, then the last-used date, then the tags, and stops at the
    // first failure, which is returned (the writes before it stay).
    static Status changeMetadataAtURL(const Url& url, const MetadataChanges& changes);
    // The five attributes as they are now.
    static ItemMetadata metadataAtURL(const Url& url);

private:
    Result<Url> urlForIdentifier(const HostPorterItemIdentifier& identifier);
    std::optional<HostPorterItemIdentifier> identifierForURL(const Url& url);
    Result<LocalItemRef> itemForIdentifierUnlogged(const HostPorterItemIdentifier& identifier);
    LocalItemRef temporaryLocalFolderItem();
    void installPacerHandler();
    void sweepTrash(std::shared_ptr<const Date> referenceDate,
                    std::function<void(size_t removed)> completion);

    std::vector<std::function<void()>> appRefreshCompletionHandlers_;
    const ProviderServices services_;
    std::shared_ptr<DispatchQueue> appRefreshQueue_;
    std::unique_ptr<Pacer> appRefreshPacer_;
};

}  // namespace tamber
