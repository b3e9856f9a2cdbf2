#include "runtime/ProviderRuntime.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "applibraries/LocalAppLibraryCache.h"
#include "applibraries/LocalAppLibraryManager.h"
#include "applibraries/SharedAppLibraryLookup.h"
#include "applibraries/TBPAppLibraryManager.h"
#include "host/HostPorterManager.h"
#include "host/StagingCopies.h"
#include "items/AppLibraryLookup.h"
#include "platform/FileContents.h"
#include "platform/FileSystem.h"
#include "support/DispatchTimer.h"
#include "support/Log.h"
#include "support/WorkerPool.h"

namespace tamber {

namespace {

std::string defaultStoragePath() {
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "/") + "/Documents";
}

Error stoppedError() {
    return Error(kPosixErrorDomain, ECANCELED, {{"description", "the runtime has shut down"}});
}

}  // namespace

ProviderRuntime::ProviderRuntime(ProviderRuntimeOptions options) : options_(std::move(options)) {
    signals_->handler = options_.onSignal;
    if (options_.fileSystem)
        previousFileSystem_ = FileSystem::setCurrent(options_.fileSystem);
    if (options_.logSink)
        previousSink_ = Log::shared().setSink(options_.logSink);
}

ProviderRuntime::~ProviderRuntime() {
    shutdown();
}

Status ProviderRuntime::prepareStorage() {
    std::lock_guard lock(mutex_);
    if (stopped_)
        return stoppedError();
    if (storagePrepared_)
        return Status::OK();
    std::string path = options_.storagePath.empty() ? defaultStoragePath() : options_.storagePath;
    storage_ = Url::fileURLWithPath(path);
    if (auto failure = FileContents::createDirectory(storage_); !failure.ok()) {
        const Error& error = failure.error();
        logError("can't create document storage folder " + storage_.path() + "; " +
                 error.description());
        return Error(error.domain(), error.code(),
                     {{"description", "can't use document storage folder " + storage_.path() +
                                          ": " + std::strerror(static_cast<int>(error.code()))}});
    }
    std::weak_ptr<SignalSlot> weakSlot = signals_;
    manager_ = std::make_shared<StorageHostPorterManager>(
        storage_,
        [weakSlot](const HostPorterItemIdentifier& container) {
            auto slot = weakSlot.lock();
            if (!slot)
                return;
            std::lock_guard lock(slot->mutex);
            if (slot->handler)
                slot->handler(container);
        },
        options_.onDeleteIndex);
    previousManager_ = HostPorterManager::installDefaultManager(manager_);
    installedManager_ = true;
    storagePrepared_ = true;
    return Status::OK();
}

Result<std::shared_ptr<TremorService>> ProviderRuntime::startJournal() {
    std::lock_guard lock(mutex_);
    if (stopped_)
        return stoppedError();
    if (journal_)
        return journal_;
    TremorStoreDirectory::LockWait lockWait{options_.lockWaitSeconds, options_.onLockWait};
    if (options_.journal == ProviderRuntimeOptions::Journal::ProcessWide) {
        TremorService::setLockWait(std::move(lockWait));
        auto service = TremorService::shared();
        if (!service.ok())
            return service.error();
        journal_ = service.value();
        return journal_;
    }
    auto service = TremorService::create(
        options_.stateDir.empty() ? TremorService::defaultStateDir() : options_.stateDir,
        options_.inotify ? options_.inotify : InotifyApi::system(),
        TremorService::kDefaultQueueLimit, std::move(lockWait));
    if (!service.ok())
        return service.error();
    if (auto error = TremorService::installShared(service.value()); !error.ok()) {
        service.value()->shutdown();
        return error.error();
    }
    journal_ = service.value();
    ownsJournal_ = true;
    return journal_;
}

Status ProviderRuntime::prepareJournal() {
    std::lock_guard lock(mutex_);
    if (auto error = prepareStorage(); !error.ok())
        return error;
    auto service = startJournal();
    if (!service.ok())
        return service.error();
    return service.value()->watchTree(storage_.path());
}

Result<std::shared_ptr<LocalPorter>> ProviderRuntime::provider() {
    std::lock_guard lock(mutex_);
    if (stopped_)
        return stoppedError();
    if (porter_)
        return porter_;
    if (auto error = prepareStorage(); !error.ok())
        return error.error();
    if (auto service = startJournal(); !service.ok())
        return service.error();
    if (!installedLookup_) {
        previousLookup_ = SharedAppLibraryLookup::install();
        installedLookup_ = true;
    }
    // The provider is handed the runtime's own objects rather than reaching for the slots.
    auto porter = LocalPorter::create(
        {manager_, options_.fileSystem ? options_.fileSystem.get() : &FileSystem::current()});
    refreshOutcome_ = porter->refreshAppLibraries();
    // Identifiers inside app libraries need their trees journaled like the storage folder,
    // all in one pass with it: a document moved between two of them while no run watched
    // keeps its ID.
    std::vector<std::string> roots{storage_.path()};
    for (const Url& root : TBPAppLibraryManager::rootURLsForAppLibraries())
        roots.push_back(root.path());
    for (const auto& [path, error] : journal_->watchTrees(roots)) {
        if (path == storage_.path())
            return error;
        logError("can't watch app library " + path + "; " + error.description());
    }
    StagingCopies::sweepStale();  // copies left by imports that were killed part-way
    porter_ = porter;
    publishing_ = true;
    return porter_;
}

Status ProviderRuntime::publishFromCache() {
    std::lock_guard lock(mutex_);
    if (stopped_)
        return stoppedError();
    if (!installedLookup_ && !AppLibraryLookup::current()) {
        previousLookup_ = SharedAppLibraryLookup::install();
        installedLookup_ = true;
    }
    auto mainCache = LocalAppLibraryCache::mainCache();
    mainCache->queue().sync([&] { mainCache->load(); });
    LocalAppLibraryManager::shared()->upgradeFromMainCache(nullptr, false);
    return Status::OK();
}

void ProviderRuntime::setSignalHandler(
    std::function<void(const HostPorterItemIdentifier&)> handler) {
    std::lock_guard lock(signals_->mutex);
    signals_->handler = std::move(handler);
}

void ProviderRuntime::drainThreads() {
    DispatchTimer::shared().shutdown();
    WorkerPool::shared().shutdown();
}

void ProviderRuntime::shutdown() {
    std::lock_guard lock(mutex_);
    if (std::exchange(stopped_, true))
        return;
    setSignalHandler({});
    porter_.reset();
    if (publishing_ && journal_)
        journal_->retireUnwatched();
    if (ownsJournal_) {
        drainThreads();
        journal_->shutdown();
        drainThreads();
        TremorService::uninstallShared(journal_);
    }
    // Blocks of a process-wide journal's run may still ask for the manager and the lookup
    // until the process stops: they stay installed then.
    if (ownsJournal_ && installedLookup_)
        AppLibraryLookup::setCurrent(std::move(previousLookup_));
    if (ownsJournal_ && installedManager_)
        HostPorterManager::installDefaultManager(std::move(previousManager_));
    if (options_.logSink)
        Log::shared().setSink(std::move(previousSink_));
    if (options_.fileSystem)
        FileSystem::setCurrent(std::move(previousFileSystem_));
    journal_.reset();
}

void ProviderRuntime::shutdownProcess() {
    TremorService::stopShared();
    drainThreads();
}

}  // namespace tamber
