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
    auto stmt = db_.prepare("SELECT DISTINCT type FROM items");
    if (!stmt.ok())
        return stmt.error();
    std::vector<std::string> types;
    for (;;) {
        auto row = stmt->step();
        if (!row.ok())
            return row.error();
        if (!row.value())
            break;
        std::string stored = stmt->columnText(0);
        if (TypeConforms(stored, type))
            types.push_back(std::move(stored));
    }
    return types;
}

Result<std::vector<nlohmann::json>> ReplicaSearch::run(const ReplicaSearchQuery& query) {
    using Value = std::variant<int64_t, std::string>;
    std::string sql = "SELECT items.json FROM items";
    std::vector<std::string> where;
    std::vector<Value> values;

    // A NUL cannot be in a filename; such a query matches nothing rather than being cut short.
    if (query.text.find('\0') != std::string::npos)
        return std::vector<nlohmann::json>();
    if (!query.text.empty()) {
        if (characterCount(query.text) >= 3) {
            sql += " JOIN names ON names.rowid = items.row";
            where.push_back("names MATCH ?");
            values.emplace_back(phrase(query.text));
        } else {
            // LIKE folds ASCII case only, as short queries mostly are.
            where.push_back("items.filename LIKE ? ESCAPE '\\'");
            values.emplace_back(likePattern(query.text));
        }
    }
    if (query.tag) {
        where.push_back("EXISTS (SELECT 1 FROM json_each(items.tags) WHERE json_each.value = ?)");
        values.emplace_back(*query.tag);
    }
    if (query.type) {
        auto types = conformingTypes(*query.type);
        if (!types.ok())
            return types.error();
        if (types->empty())
            return std::vector<nlohmann::json>();
        std::string in = "items.type IN (";
        for (size_t i = 0; i < types->size(); ++i) {
            in += i ? ", ?" : "?";
            values.emplace_back(types.value()[i]);
        }
        where.push_back(in + ")");
    }
    if (query.favorites)
        where.push_back("items.favorite IS NOT NULL");
    if (query.recent)
        where.push_back("items.lastUsed IS NOT NULL");
    if (query.trashed) {
        where.push_back("items.trashed = ?");
        values.emplace_back(int64_t{*query.trashed ? 1 : 0});
    }
    for (size_t i = 0; i < where.size(); ++i) sql += (i ? " AND " : " WHERE ") + where[i];
    sql += query.recent ? " ORDER BY items.lastUsed DESC, items.filename, items.id"
                        : " ORDER BY items.filename, items.id";
    const size_t limit = std::clamp<size_t>(query.limit, 1, ReplicaStore::kMaxLimit);
    sql += " LIMIT " + std::to_string(limit);

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
    for (;;) {
        auto row = stmt->step();
        if (!row.ok())
            return row.error();
        if (!row.value())
            break;
        auto json = nlohmann::json::parse(stmt->columnText(0), nullptr, false);
        if (!json.is_discarded())
            items.push_back(std::move(json));
    }
    return items;
}

}  // namespace tamber
