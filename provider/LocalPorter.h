#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterExtension.h"
#include "items/LocalItem.h"
#include "platform/apps/AppRecord.h"
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
    LocalPorter();
    static std::shared_ptr<LocalPorter> create();

    const std::shared_ptr<DispatchQueue>& appRefreshQueue() const { return appRefreshQueue_; }
    Pacer& appRefreshPacer() const { return *appRefreshPacer_; }

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

    // Enumerators: the root enumerator for the three root-served containers, a folder
    // enumerator for any other container; either is started before it is returned.
    Result<HostPorterEnumeratorRef> enumeratorForContainerItemIdentifier(
        const HostPorterItemIdentifier& identifier) override;

    // Item operations. Every completion is called exactly once, on whatever thread the file
    // operation finishes, with the item (or success) or the error.
    using ItemCompletion = std::function<void(Result<LocalItemRef> item)>;
    using ErrorCompletion = std::function<void(Status status)>;
    void importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                             ItemCompletion completion);
    // A taken name bounces to "name 2", ... (as a file browser's new folder does); with
    // `bounce` false it fails with EEXIST instead.
    void createDirectoryWithName(const std::string& name, const HostPorterItemIdentifier& parent,
                                 ItemCompletion completion);
    void createDirectoryWithName(const std::string& name, const HostPorterItemIdentifier& parent,
                                 bool bounce, ItemCompletion completion);
    void renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                  const std::string& name, ItemCompletion completion);
    void reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                    const HostPorterItemIdentifier& parent,
                                    const std::optional<std::string>& newName,
                                    ItemCompletion completion);
    void deleteItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                  ErrorCompletion completion);

    // Trash and put-back.
    void trashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                 ItemCompletion completion);
    void untrashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                   const std::optional<HostPorterItemIdentifier>& parent,
                                   ItemCompletion completion);
    // Removes what was trashed before `referenceDate`, stamps what has no trash date; the
    // completion runs on "tamber.auto-delete.notifier" once every deletion has finished.
    void _removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                          std::function<void()> completion);

    // Metadata.
    void setLastUsedDate(std::shared_ptr<const Date> date,
                         const HostPorterItemIdentifier& identifier, ItemCompletion completion);
    void setTagData(const std::optional<Bytes>& tagData, const HostPorterItemIdentifier& identifier,
                    ItemCompletion completion);
    void setFavoriteRank(std::shared_ptr<const Number> rank,
                         const HostPorterItemIdentifier& identifier, ItemCompletion completion);

    // Thumbnails: only app libraries have one, their app's icon as PNG.
    struct ThumbnailSize {
        double width = 0;
        double height = 0;
    };
    using PerThumbnailCompletion =
        std::function<void(const HostPorterItemIdentifier& identifier, std::optional<Bytes> png,
                           std::optional<Error> error)>;
    using PerThumbnailCompletionWithType =
        std::function<void(const HostPorterItemIdentifier& identifier, std::optional<Bytes> png,
                           const std::string& typeIdentifier, std::optional<Error> error)>;
    void fetchThumbnailsForItemIdentifiers(const std::vector<HostPorterItemIdentifier>& identifiers,
                                           ThumbnailSize requestedSize,
                                           PerThumbnailCompletion perThumbnailCompletion,
                                           ErrorCompletion completion);
    void fetchThumbnailsForItemIdentifiers(const std::vector<HostPorterItemIdentifier>& identifiers,
                                           ThumbnailSize requestedSize,
                                           PerThumbnailCompletionWithType perThumbnailCompletion,
                                           ErrorCompletion completion);
    std::optional<Bytes> bestIconData(const AppRecord& record);

    // The app library item of one app.
    void _defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                         ItemCompletion completion);

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

private:
    Result<Url> urlForIdentifier(const HostPorterItemIdentifier& identifier);
    std::optional<HostPorterItemIdentifier> identifierForURL(const Url& url);
    Result<LocalItemRef> itemForIdentifierUnlogged(const HostPorterItemIdentifier& identifier);
    LocalItemRef temporaryLocalFolderItem();
    void installPacerHandler();

    std::vector<std::function<void()>> appRefreshCompletionHandlers_;
    std::shared_ptr<DispatchQueue> appRefreshQueue_;
    std::unique_ptr<Pacer> appRefreshPacer_;
};

}  // namespace tamber
