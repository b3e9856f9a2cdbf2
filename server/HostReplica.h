#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "host/HostPorterExtension.h"
#include "host/HostPorterItemIdentifier.h"
#include "host/HostPorterManager.h"
#include "support/Result.h"

namespace tamber {

class TremorService;

// What `GET search` asks for. Every filter given must hold.
struct ReplicaSearchQuery {
    std::string text;                 // substring of the filename, any case; empty: any name
    std::optional<std::string> tag;   // has this tag label
    std::optional<std::string> type;  // conforms to this type ("public.image" finds PNG, JPEG)
    bool favorites = false;           // has a favourite rank
    bool recent = false;              // has a last-used date; newest first
    std::optional<bool> trashed;      // in a trash (true) or not (false); unset: either
    size_t limit = 100;
};

// What `GET status` reports.
struct ReplicaStatus {
    bool ready = false;                   // the first catch-up is done and none is running
    bool catchingUp = false;              // a catch-up is running
    uint64_t items = 0;                   // items in the replica
    uint64_t journalLagEvents = 0;        // events journaled but not yet reflected in the replica
    std::optional<double> lastEventTime;  // seconds since the epoch of the last event seen
    bool historyLost = false;             // the journal lost history since the server started
    uint64_t sequence = 0;                // the last batch applied
};

// One batch the replica applied, as the `changes` server-sent event carries it:
// {"updated": [items], "deleted": [identifiers], "changes": [in order]}. When the replica was
// listed again from scratch (no anchor, or it expired), subscribers get one batch with
// "reset": true and empty lists instead: everything may have changed, and batchesSince() for
// any earlier sequence fails with -1002.
struct ReplicaBatch {
    uint64_t sequence = 0;
    nlohmann::json changes;
};

// The host's replica of what it enumerated, and the search index over it: kept in SQLite under
// the host's state folder, caught up from the provider's changes whenever the provider signals,
// and told to forget the index entries of app libraries the provider removed. The server owns
// one; its HTTP routes read status, search and the batch history through this interface.
//
// Thread safety: every method may be called from any thread at the same time.
class HostReplica {
public:
    struct Options {
        std::string databasePath;  // created when missing; rebuilt when unreadable
        std::shared_ptr<HostPorterExtension> provider;
        std::shared_ptr<TremorService> journal;  // for the status; may be null
        size_t historyBatches = 10000;           // batches kept for reconnecting clients
    };
    // Opens (or rebuilds) the database. Does not talk to the provider yet.
    static Result<std::unique_ptr<HostReplica>> open(Options options);

    virtual ~HostReplica() = default;

    // Starts the first catch-up in the background: changes since the stored anchor until no
    // more are coming, or a full listing of the working set when there is no anchor or it
    // expired.
    virtual void start() = 0;
    // The provider signalled a container: schedules one catch-up (signals during a catch-up
    // cause one more, not one each).
    virtual void signal(const HostPorterItemIdentifier& container) = 0;
    // Deletes the index entries of these app libraries and calls `completion` once that is
    // committed.
    virtual void deleteSearchableItems(const std::vector<std::string>& domainIdentifiers,
                                       HostPorterManager::Completion completion) = 0;
    // Waits until the first catch-up is done; false when `timeout` passed first.
    virtual bool waitUntilReady(std::chrono::milliseconds timeout) = 0;

    virtual ReplicaStatus status() = 0;
    // Matching items as HostJson::item encodes them, at most query.limit.
    virtual Result<std::vector<nlohmann::json>> search(const ReplicaSearchQuery& query) = 0;

    // The batches applied after `sequence`, oldest first. Fails with HostPorterErrorDomain code
    // -1002 when some of them are no longer kept (the client must start over).
    virtual Result<std::vector<ReplicaBatch>> batchesSince(uint64_t sequence) = 0;
    // Calls `listener` after every batch the replica commits, on the replica's thread; it must
    // not block. Returns a handle for unsubscribe().
    using Listener = std::function<void(const ReplicaBatch&)>;
    virtual uint64_t subscribe(Listener listener) = 0;
    virtual void unsubscribe(uint64_t handle) = 0;

    // Finishes the catch-up in progress (or abandons it between batches), stops the
    // background thread and closes the database. Harmless to call twice.
    virtual void shutdown() = 0;
};

}  // namespace tamber
