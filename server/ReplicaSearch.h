#pragma once

#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/tremors/SqliteDatabase.h"
#include "server/HostReplica.h"
#include "support/Result.h"

namespace tamber {

// One search over the replica's items: builds the query from the filters and reads the
// matching items' JSON.
//
// A name of three characters or more is looked up in the trigram index (any case, any
// position); a shorter one has no trigram to look up and is matched with LIKE instead. A type
// filter becomes the list of stored types that conform to it (few distinct types, and the
// conformance graph lives in code), so that the row limit stays in SQL.
class ReplicaSearch {
public:
    explicit ReplicaSearch(SqliteDatabase& db) : db_(db) {}

    Result<std::vector<nlohmann::json>> run(const ReplicaSearchQuery& query);

    // The FTS5 phrase that matches `text` as a substring: quoted, with quotes doubled.
    static std::string phrase(const std::string& text);
    // `text` as a LIKE pattern for a substring, with \ as the escape character.
    static std::string likePattern(const std::string& text);

private:
    Result<std::vector<std::string>> conformingTypes(const std::string& type);

    SqliteDatabase& db_;
};

}  // namespace tamber
