#pragma once

#include <string>
#include <variant>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/tremors/SqliteDatabase.h"
#include "server/HostReplica.h"
#include "support/Result.h"

namespace tamber {

// One search over the replica's items: builds the query from the filters and reads the
// matching items' JSON.
//
// A text of three characters or more that few names match is looked up in the trigram index
// (any case, any position); a shorter one, or one that thousands of names match, is matched
// with LIKE while walking the names in order, which stops at the limit (LIKE folds ASCII case
// only). A type
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

    // From this many matches on, a text is looked for by walking the names in order.
    static constexpr size_t kCommonMatches = 2000;

private:
    using Values = std::vector<std::variant<int64_t, std::string>>;
    Result<std::vector<nlohmann::json>> read(const std::string& sql, const Values& values);
    // Whether `text` matches so many names (or is too short for a trigram) that the names are
    // better walked in order.
    Result<bool> isCommon(const std::string& text);
    Result<std::vector<std::string>> conformingTypes(const std::string& type);

    SqliteDatabase& db_;
};

}  // namespace tamber
