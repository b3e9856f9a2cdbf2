#include "server/ReplicaSearch.h"

#include <algorithm>
#include <variant>

#include "platform/TypeIdentifiers.h"
#include "server/ReplicaStore.h"

namespace tamber {

namespace {

// Trigrams count characters, not bytes.
size_t characterCount(const std::string& text) {
    return static_cast<size_t>(std::count_if(text.begin(), text.end(), [](char c) {
        return (static_cast<unsigned char>(c) & 0xC0) != 0x80;
    }));
}

}  // namespace

std::string ReplicaSearch::phrase(const std::string& text) {
    std::string out = "\"";
    for (char c : text) {
        if (c == '"')
            out += '"';
        out += c;
    }
    return out + "\"";
}

std::string ReplicaSearch::likePattern(const std::string& text) {
    std::string out = "%";
    for (char c : text) {
        if (c == '%' || c == '_' || c == '\\')
            out += '\\';
        out += c;
    }
    return out + "%";
}

Result<std::vector<std::string>> ReplicaSearch::conformingTypes(const std::string& type) {
    // One index step per distinct type rather than a pass over every item.
    auto stmt = db_.cached(
        "WITH RECURSIVE t(type) AS (SELECT min(type) FROM items UNION ALL "
        "SELECT (SELECT min(type) FROM items WHERE type > t.type) FROM t WHERE t.type IS NOT NULL) "
        "SELECT type FROM t WHERE type IS NOT NULL");
    if (!stmt.ok())
        return stmt.error();
    std::vector<std::string> types;
    Status read = stmt->eachRow([&] {
        std::string stored = stmt->columnText(0);
        if (TypeConforms(stored, type))
            types.push_back(std::move(stored));
        return Status::OK();
    });
    if (!read.ok())
        return read.error();
    return types;
}

Result<std::vector<nlohmann::json>> ReplicaSearch::run(const ReplicaSearchQuery& query) {
    // A NUL cannot be in a filename; such a query matches nothing rather than being cut short.
    if (query.text.find('\0') != std::string::npos)
        return std::vector<nlohmann::json>();
    Values values;
    std::string filters;
    if (query.tag) {
        filters += " AND EXISTS (SELECT 1 FROM json_each(items.tags) WHERE json_each.value = ?)";
        values.emplace_back(*query.tag);
    }
    if (query.type) {
        auto types = conformingTypes(*query.type);
        if (!types.ok())
            return types.error();
        if (types->empty())
            return std::vector<nlohmann::json>();
        // "+" keeps the planner walking the names in order instead of the type index.
        filters += " AND +items.type IN (";
        for (size_t i = 0; i < types->size(); ++i) {
            filters += i ? ", ?" : "?";
            values.emplace_back(types.value()[i]);
        }
        filters += ")";
    }
    if (query.favorites)
        filters += " AND items.favorite IS NOT NULL";
    if (query.trashed) {
        filters += " AND items.trashed = ?";
        values.emplace_back(int64_t{*query.trashed ? 1 : 0});
    }
    const std::string recent = query.recent ? " AND items.lastUsed IS NOT NULL" : "";
    const std::string order = query.recent
                                  ? " ORDER BY items.lastUsed DESC, items.filename, items.id"
                                  : " ORDER BY items.filename, items.id";
    const size_t limit = std::clamp<size_t>(query.limit, 1, ReplicaStore::kMaxLimit);
    const std::string tail = order + " LIMIT " + std::to_string(limit);

    if (query.text.empty())
        return read("SELECT items.json FROM items WHERE 1" + recent + filters + tail, values);
    Values withText{likePattern(query.text)};
    withText.insert(withText.end(), values.begin(), values.end());
    const std::string like = " AND items.filename LIKE ? ESCAPE '\\'";
    auto common = isCommon(query.text);
    if (!common.ok())
        return common.error();
    if (common.value()) {
        // Many names match (or the text is too short for a trigram): walking the names in
        // order, each tested, reaches the limit sooner than sorting every match would.
        return read("SELECT items.json FROM items WHERE 1" + recent + like + filters + tail,
                    withText);
    }
    // Few names match: the trigram index finds them, in any case.
    Values withPhrase{phrase(query.text)};
    withPhrase.insert(withPhrase.end(), values.begin(), values.end());
    return read(
        "SELECT items.json FROM items JOIN names ON names.rowid = items.row WHERE names "
        "MATCH ?" +
            recent + filters + tail,
        withPhrase);
}

Result<bool> ReplicaSearch::isCommon(const std::string& text) {
    if (characterCount(text) < 3)
        return true;
    auto stmt = db_.cached("SELECT count(*) FROM (SELECT 1 FROM names WHERE names MATCH ? LIMIT " +
                           std::to_string(kCommonMatches) + ")");
    if (!stmt.ok())
        return stmt.error();
    auto row = stmt->bind(1, phrase(text)).step();
    if (!row.ok())
        return row.error();
    return row.value() && static_cast<size_t>(stmt->columnInt64(0)) >= kCommonMatches;
}

Result<std::vector<nlohmann::json>> ReplicaSearch::read(const std::string& sql,
                                                        const Values& values) {
    auto stmt = db_.prepare(sql);
    if (!stmt.ok())
        return stmt.error();
    for (size_t i = 0; i < values.size(); ++i) {
        const int index = static_cast<int>(i + 1);
        if (const auto* number = std::get_if<int64_t>(&values[i]))
            stmt->bind(index, *number);
        else
            stmt->bind(index, std::string_view(std::get<std::string>(values[i])));
    }
    std::vector<nlohmann::json> items;
    Status read = stmt->eachRow([&] {
        auto json = nlohmann::json::parse(stmt->columnText(0), nullptr, false);
        if (!json.is_discarded())
            items.push_back(std::move(json));
        return Status::OK();
    });
    if (!read.ok())
        return read.error();
    return items;
}

}  // namespace tamber
