#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "host/HostPorterItem.h"
#include "host/HostPorterPage.h"
#include "platform/tremors/SqliteDatabase.h"
#include "runtime/ChangeCollector.h"
#include "server/HostReplica.h"
#include "support/Result.h"

namespace tamber {

// The replica's SQLite file: every item of the working set by identifier (the columns search
// filters on, plus the item's JSON so that answers keep its exact shape), a trigram index over
// the filenames, the working-set anchor and the history of applied batches.
//
// Every change and the anchor that covers it are written in one transaction, so that after a
// crash the anchor never runs ahead of the items. Not thread-safe: the owner serialises calls.
class ReplicaStore {
public:
    static constexpr int64_t kSchemaVersion = 1;

    // Opens the database at `path`, creating it (and its folder) when missing. A file that
    // SQLite cannot read, or that has another schema version, is deleted and made anew, with
    // one error line: the caller then finds no anchor and lists everything again.
    static Result<std::unique_ptr<ReplicaStore>> open(const std::string& path);

    // The anchor the items stand at; nothing before the first full listing.
    Result<std::optional<HostPorterSyncAnchor>> anchor();
    Result<uint64_t> itemCount();
    Result<bool> holds(const HostPorterItemIdentifier& identifier);
    // The last sequence number handed out (0 before the first batch).
    uint64_t sequence() const { return sequence_; }

    // Replaces every item with `items` and stores `anchor`, in one transaction. History before
    // it is gone (a client must start over), so the floor moves past it; returns the sequence
    // number the replacement took.
    Result<uint64_t> replaceAll(const std::vector<HostPorterItemRef>& items,
                                const HostPorterSyncAnchor& anchor);
    // Applies the batch's changes in their order and stores its anchor, in one transaction.
    // A batch with changes gets the next sequence number and is kept in the history (pruned to
    // `historyBatches`); returns it. A batch without changes only moves the anchor: nothing.
    Result<std::optional<ReplicaBatch>> applyBatch(const ChangeCollector::Batch& batch,
                                                   size_t historyBatches);
    // Deletes the items of these app libraries (the library items and everything under their
    // folders) in one transaction; returns how many went.
    Result<uint64_t> deleteDomains(const std::vector<std::string>& domainIdentifiers);

    // The kept batches after `sequence`, oldest first; -1002 when some are gone.
    Result<std::vector<ReplicaBatch>> batchesSince(uint64_t sequence);

    // Matching items' JSON, at most query.limit (clamped to 1..kMaxLimit).
    static constexpr size_t kMaxLimit = 1000;
    Result<std::vector<nlohmann::json>> search(const ReplicaSearchQuery& query);

    SqliteDatabase& database() { return *db_; }

private:
    explicit ReplicaStore(std::unique_ptr<SqliteDatabase> db);
    static Result<std::unique_ptr<SqliteDatabase>> openChecked(const std::string& path);
    static Status createSchema(SqliteDatabase& db);
    Status loadCounters();
    Status upsert(const HostPorterItem& item, const nlohmann::json& json);
    Status remove(const HostPorterItemIdentifier& identifier);
    Status setMeta(const char* key, int64_t value);
    Status setAnchor(const HostPorterSyncAnchor& anchor);

    std::unique_ptr<SqliteDatabase> db_;
    uint64_t sequence_ = 0;
    uint64_t floor_ = 0;  // batches up to this one are no longer kept
};

}  // namespace tamber
