#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>

#include "server/HostReplica.h"
#include "server/ReplicaStore.h"
#include "server/ReplicaSync.h"
#include "support/Mutex.h"
#include "support/MutexLock.h"

namespace tamber {

// The host's replica: the SQLite store, the catch-up thread that fills it, the subscribers of
// its batches and the status the server reports.
//
// Locks: `storeMutex_` is held only while the store is read or written, never while the
// provider works or a completion or listener runs; so an index deletion that the provider asks
// for from inside a change enumeration (on a thread the catch-up waits for) never waits for the
// catch-up.
class SqliteReplica : public HostReplica, private ReplicaSync::Sink {
public:
    // As HostReplica::open, with hooks into the catch-up for tests.
    static Result<std::unique_ptr<SqliteReplica>> open(Options options, ReplicaSync::Hooks hooks);
    ~SqliteReplica() override;

    void start() override;
    void signal(const HostPorterItemIdentifier& container) override;
    void deleteSearchableItems(const std::vector<std::string>& domainIdentifiers,
                               HostPorterManager::Completion completion) override;
    bool waitUntilReady(std::chrono::milliseconds timeout) override;
    ReplicaStatus status() override;
    Result<std::vector<nlohmann::json>> search(const ReplicaSearchQuery& query) override;
    Result<std::vector<ReplicaBatch>> batchesSince(uint64_t sequence) override;
    uint64_t subscribe(Listener listener) override;
    void unsubscribe(uint64_t handle) override;
    void shutdown() override;

    // Catch-ups run so far (for tests of coalescing).
    uint64_t catchUps() { return sync_->catchUps(); }

private:
    SqliteReplica(Options options, std::unique_ptr<ReplicaStore> store, ReplicaSync::Hooks hooks);

    // ReplicaSync::Sink.
    Result<std::optional<HostPorterSyncAnchor>> storedAnchor() override;
    Status replaceAll(const std::vector<HostPorterItemRef>& items,
                      const HostPorterSyncAnchor& anchor) override;
    Result<bool> apply(const ChangeCollector::Batch& batch) override;
    void anchorExpired() override;

    // After a commit: the counters the status reads.
    void noteCommitted(const HostPorterSyncAnchor* anchor) REQUIRES(storeMutex_);
    void publish(const ReplicaBatch& batch);
    static Error closed();

    const Options options_;
    Mutex storeMutex_;
    std::unique_ptr<ReplicaStore> store_ GUARDED_BY(storeMutex_);

    std::atomic<uint64_t> items_{0};
    std::atomic<uint64_t> sequence_{0};
    std::atomic<uint64_t> anchorEventId_{0};  // where the replica's anchor stands in the journal
    std::atomic<uint64_t> lastEventId_{0};    // the journal's last event
    std::atomic<double> lastEventTime_{0};    // 0: none seen since start
    std::atomic<bool> historyLost_{false};
    Mutex journalMutex_;
    std::optional<uint64_t> journalListener_ GUARDED_BY(journalMutex_);

    Mutex listenersMutex_;
    std::map<uint64_t, Listener> listeners_ GUARDED_BY(listenersMutex_);
    uint64_t nextListener_ GUARDED_BY(listenersMutex_) = 1;

    // Last: it calls the members above from its thread, so it goes first.
    std::unique_ptr<ReplicaSync> sync_;
};

}  // namespace tamber
