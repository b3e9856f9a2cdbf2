#include "applibraries/LocalAppLibraryManager.h"
#include "host/HostPorterManager.h"
#include "provider/LocalPorter.h"
#include "support/Log.h"

namespace tamber {

namespace {

void signalContainer(HostPorterManager& manager, const HostPorterItemIdentifier& container) {
    logInfo("notify changes on " + container);
    manager.signalEnumeratorForContainerItemIdentifier(container, [](std::optional<Error>) {});
}

}  // namespace

LocalPorter::AppRefreshOutcome LocalPorter::refreshAppLibraries() {
    AppRefreshOutcome outcome;
    auto manager = LocalAppLibraryManager::shared();
    // The registry is read at background priority; this thread waits for it.
    LocalAppLibraryManager::backgroundQueue().sync(
        [&] { outcome.rootChanged = manager->refresh(); });
    logDebug("auto-upgrading shared app library manager");
    outcome.workingSetChanged = manager->upgradeFromMainCache(nullptr, false);

    // Handlers stay registered: each later refresh calls them again.
    std::vector<std::function<void()>> handlers;
    if (appRefreshQueue_->isCurrent())
        handlers = appRefreshCompletionHandlers_;
    else
        appRefreshQueue_->sync([&] { handlers = appRefreshCompletionHandlers_; });
    for (auto& handler : handlers) handler();

    if (outcome.rootChanged)
        signalContainer(*services_.manager, HostPorterRootContainerItemIdentifier);
    if (outcome.workingSetChanged)
        signalContainer(*services_.manager, HostPorterWorkingSetContainerItemIdentifier);
    return outcome;
}

void LocalPorter::_refreshInstalledAppsWithCompletionHandler(std::function<void()> completion) {
    auto self = shared_from_this();
    appRefreshQueue_->async([self, completion = std::move(completion)]() mutable {
        self->appRefreshCompletionHandlers_.push_back(std::move(completion));
        self->appRefreshPacer_->signal();
    });
}

void LocalPorter::refreshInstalledAppsWithCompletionHandler(std::function<void()> completion) {
    _refreshInstalledAppsWithCompletionHandler(std::move(completion));
}

}  // namespace tamber
