#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "host/HostPorterExtension.h"
#include "items/LocalItem.h"
#include "support/DispatchQueue.h"
#include "support/Pacer.h"

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
