#pragma once

#include <condition_variable>
#include <map>
#include <mutex>
#include <vector>

#include "server/HostReplica.h"

namespace tamber::testing {

// A replica whose batches, status and search answers the test sets, and which records what the
// server asks of it.
class FakeHostReplica : public HostReplica {
public:
    // Publishes a batch with the next sequence number, as the real replica does after a commit.
    uint64_t publish(nlohmann::json changes) {
        ReplicaBatch batch;
        std::map<uint64_t, Listener> listeners;
        {
            std::lock_guard lock(mutex_);
            batch.sequence = ++sequence_;
            batch.changes = std::move(changes);
            history_.push_back(batch);
            listeners = listeners_;
        }
        for (auto& [handle, listener] : listeners) listener(batch);
        return batch.sequence;
    }
    // Forgets the batches up to and including `sequence`.
    void forgetThrough(uint64_t sequence) {
        std::lock_guard lock(mutex_);
        std::erase_if(history_, [&](const ReplicaBatch& b) { return b.sequence <= sequence; });
        forgotten_ = sequence;
    }
    void setStatus(ReplicaStatus status) {
        std::lock_guard lock(mutex_);
        status_ = status;
    }
    void setSearchResults(std::vector<nlohmann::json> items) {
        std::lock_guard lock(mutex_);
        results_ = std::move(items);
    }
    std::optional<ReplicaSearchQuery> lastQuery() {
        std::lock_guard lock(mutex_);
        return lastQuery_;
    }
    std::vector<HostPorterItemIdentifier> signals() {
        std::lock_guard lock(mutex_);
        return signals_;
    }
    // Waits (up to `seconds`) until at least `count` signals came.
    bool waitForSignals(size_t count, double seconds) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::duration<double>(seconds),
                                 [&] { return signals_.size() >= count; });
    }
    size_t listenerCount() {
        std::lock_guard lock(mutex_);
        return listeners_.size();
    }
    bool started() {
        std::lock_guard lock(mutex_);
        return started_;
    }
    bool wasShutDown() {
        std::lock_guard lock(mutex_);
        return shutDown_;
    }

    void start() override {
        std::lock_guard lock(mutex_);
        started_ = true;
    }
    void signal(const HostPorterItemIdentifier& container) override {
        {
            std::lock_guard lock(mutex_);
            signals_.push_back(container);
        }
        changed_.notify_all();
    }
    void deleteSearchableItems(const std::vector<std::string>&,
                               HostPorterManager::Completion completion) override {
        if (completion)
            completion(std::nullopt);
    }
    bool waitUntilReady(std::chrono::milliseconds) override { return true; }
    ReplicaStatus status() override {
        std::lock_guard lock(mutex_);
        return status_;
    }
    Result<std::vector<nlohmann::json>> search(const ReplicaSearchQuery& query) override {
        std::lock_guard lock(mutex_);
        lastQuery_ = query;
        return results_;
    }
    Result<std::vector<ReplicaBatch>> batchesSince(uint64_t sequence) override {
        std::lock_guard lock(mutex_);
        if (sequence < forgotten_)
            return Error::syncAnchorExpired();
        std::vector<ReplicaBatch> batches;
        for (const auto& batch : history_)
            if (batch.sequence > sequence)
                batches.push_back(batch);
        return batches;
    }
    uint64_t subscribe(Listener listener) override {
        std::lock_guard lock(mutex_);
        listeners_[++nextHandle_] = std::move(listener);
        return nextHandle_;
    }
    void unsubscribe(uint64_t handle) override {
        std::lock_guard lock(mutex_);
        listeners_.erase(handle);
    }
    void shutdown() override {
        std::lock_guard lock(mutex_);
        shutDown_ = true;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    uint64_t sequence_ = 0;
    uint64_t forgotten_ = 0;
    std::vector<ReplicaBatch> history_;
    std::map<uint64_t, Listener> listeners_;
    uint64_t nextHandle_ = 0;
    ReplicaStatus status_;
    std::vector<nlohmann::json> results_;
    std::optional<ReplicaSearchQuery> lastQuery_;
    std::vector<HostPorterItemIdentifier> signals_;
    bool started_ = false;
    bool shutDown_ = false;
};

}  // namespace tamber::testing
