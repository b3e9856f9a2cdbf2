#include "server/SqliteReplica.h"

#include <cerrno>
#include <chrono>

#include "fs/FSChangeToken.h"
#include "host/ItemIdentifier.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorService.h"
#include "support/Log.h"

namespace tamber {

Result<std::unique_ptr<HostReplica>> HostReplica::open(Options options) {
    auto replica = SqliteReplica::open(std::move(options), {});
    if (!replica.ok())
        return replica.error();
    return std::unique_ptr<HostReplica>(std::move(replica).value());
}

Result<std::unique_ptr<SqliteReplica>> SqliteReplica::open(Options options,
                                                           ReplicaSync::Hooks hooks) {
    if (!options.provider)
        return Error::invalidParameter("provider");
    auto store = ReplicaStore::open(options.databasePath);
    if (!store.ok())
        return store.error();
    return std::unique_ptr<SqliteReplica>(
        new SqliteReplica(std::move(options), std::move(store).value(), std::move(hooks)));
}

SqliteReplica::SqliteReplica(Options options, std::unique_ptr<ReplicaStore> store,
                             ReplicaSync::Hooks hooks)
    : options_(std::move(options)), store_(std::move(store)) {
    {
        MutexLock lock(storeMutex_);
        auto anchor = store_->anchor();
        noteCommitted(anchor.ok() && anchor.value() ? &*anchor.value() : nullptr);
    }
    sync_ = std::make_unique<ReplicaSync>(options_.provider, static_cast<ReplicaSync::Sink&>(*this),
                                          std::move(hooks));
}

SqliteReplica::~SqliteReplica() {
    shutdown();
}

Error SqliteReplica::closed() {
    return Error::posix(ECANCELED);
}

void SqliteReplica::start() {
    MutexLock lock(journalMutex_);
    if (options_.journal && !journalListener_) {
        lastEventId_ = options_.journal->currentEventId();
        journalListener_ = options_.journal->addListener(
            [this](uint32_t, const std::vector<JournalEvent>& events) {
                constexpr uint32_t kLost =
                    kTremorMustScanSubdirs | kTremorUserDropped | kTremorKernelDropped;
                uint64_t last = lastEventId_.load();
                for (const auto& event : events) {
                    last = std::max(last, event.id);
                    if (event.flags & kLost)
                        historyLost_ = true;
                }
                lastEventId_ = last;
                if (!events.empty()) {
                    lastEventTime_ = std::chrono::duration<double>(
                                         std::chrono::system_clock::now().time_since_epoch())
                                         .count();
                }
            });
    }
    sync_->start();
}

void SqliteReplica::signal(const HostPorterItemIdentifier&) {
    // Every container the provider signals is part of the working set, which is caught up whole.
    sync_->signal();
}

bool SqliteReplica::waitUntilReady(std::chrono::milliseconds timeout) {
    return sync_->waitUntilReady(timeout);
}

void SqliteReplica::deleteSearchableItems(const std::vector<std::string>& domainIdentifiers,
                                          HostPorterManager::Completion completion) {
    std::optional<Error> failure;
    {
        MutexLock lock(storeMutex_);
        if (!store_) {
            failure = closed();
        } else {
            auto removed = store_->deleteDomains(domainIdentifiers);
            if (removed.ok()) {
                noteCommitted(nullptr);
                logInfo("replica removed " + std::to_string(removed.value()) +
                        " index entries of removed app libraries");
            } else {
                failure = removed.error();
            }
        }
    }
    // Committed (or failed) and unlocked: the provider's upgrade that waits for this goes on.
    if (completion)
        completion(std::move(failure));
}

ReplicaStatus SqliteReplica::status() {
    ReplicaStatus status;
    status.ready = sync_->ready();
    status.catchingUp = sync_->catchingUp();
    status.items = items_;
    const uint64_t last = lastEventId_;
    const uint64_t at = anchorEventId_;
    status.journalLagEvents = last > at ? last - at : 0;
    if (double time = lastEventTime_; time > 0)
        status.lastEventTime = time;
    status.historyLost = historyLost_;
    status.sequence = sequence_;
    return status;
}

Result<std::vector<nlohmann::json>> SqliteReplica::search(const ReplicaSearchQuery& query) {
    MutexLock lock(storeMutex_);
    if (!store_)
        return closed();
    return store_->search(query);
}

Result<std::vector<ReplicaBatch>> SqliteReplica::batchesSince(uint64_t sequence) {
    MutexLock lock(storeMutex_);
    if (!store_)
        return closed();
    return store_->batchesSince(sequence);
}

uint64_t SqliteReplica::subscribe(Listener listener) {
    MutexLock lock(listenersMutex_);
    uint64_t handle = nextListener_++;
    listeners_[handle] = std::move(listener);
    return handle;
}

void SqliteReplica::unsubscribe(uint64_t handle) {
    MutexLock lock(listenersMutex_);
    listeners_.erase(handle);
}

void SqliteReplica::shutdown() {
    // The thread first: it may be between two batches, never inside one.
    sync_->stop();
    {
        MutexLock lock(journalMutex_);
        if (journalListener_) {
            options_.journal->removeListener(*journalListener_);
            journalListener_.reset();
        }
    }
    MutexLock lock(storeMutex_);
    store_.reset();
}

Result<std::optional<HostPorterSyncAnchor>> SqliteReplica::storedAnchor() {
    MutexLock lock(storeMutex_);
    if (!store_)
        return closed();
    return store_->anchor();
}

Status SqliteReplica::replaceAll(const std::vector<HostPorterItemRef>& items,
                                 const HostPorterSyncAnchor& anchor) {
    uint64_t sequence;
    {
        MutexLock lock(storeMutex_);
        if (!store_)
            return closed();
        auto replaced = store_->replaceAll(items, anchor);
        if (!replaced.ok())
            return replaced.error();
        sequence = replaced.value();
        noteCommitted(&anchor);
    }
    // Everything may have changed and the history before it is gone: subscribers start over.
    publish({sequence,
             {{"reset", true},
              {"updated", nlohmann::json::array()},
              {"deleted", nlohmann::json::array()},
              {"changes", nlohmann::json::array()}}});
    return Status::OK();
}

Result<bool> SqliteReplica::apply(const ChangeCollector::Batch& batch) {
    std::optional<ReplicaBatch> applied;
    bool newLibrary = false;
    {
        MutexLock lock(storeMutex_);
        if (!store_)
            return closed();
        for (const auto& item : batch.updated) {
            if (newLibrary || !item ||
                !ItemIdentifier::parse(item->itemIdentifier()).isAppLibrary())
                continue;
            auto held = store_->holds(item->itemIdentifier());
            if (!held.ok())
                return held.error();
            newLibrary = !held.value();
        }
        auto result = store_->applyBatch(batch, options_.historyBatches);
        if (!result.ok())
            return result.error();
        applied = std::move(result).value();
        noteCommitted(batch.anchor ? &*batch.anchor : nullptr);
    }
    if (applied)
        publish(*applied);
    return newLibrary;
}

void SqliteReplica::anchorExpired() {
    historyLost_ = true;
}

void SqliteReplica::noteCommitted(const HostPorterSyncAnchor* anchor) {
    if (auto count = store_->itemCount(); count.ok())
        items_ = count.value();
    sequence_ = store_->sequence();
    if (anchor) {
        if (auto token = FSChangeToken::decode(*anchor))
            anchorEventId_ = token->streamEventID;
    }
}

void SqliteReplica::publish(const ReplicaBatch& batch) {
    std::vector<Listener> listeners;
    {
        MutexLock lock(listenersMutex_);
        for (const auto& [handle, listener] : listeners_) listeners.push_back(listener);
    }
    for (const auto& listener : listeners) listener(batch);
}

}  // namespace tamber
