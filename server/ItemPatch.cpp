#include "server/ItemPatch.h"

#include <cmath>
#include <set>

#include "platform/Tag.h"
#include "runtime/ProviderCalls.h"
#include "server/ApiReply.h"
#include "server/RouteSupport.h"

namespace tamber {

namespace {

Error badField(const std::string& field, const std::string& expected) {
    return ApiReply::badRequest(field + " must be " + expected);
}

}  // namespace

Result<ItemPatch> ItemPatch::parse(const nlohmann::json& body) {
    static const std::set<std::string> kFields{"filename",     "parentIdentifier", "tags",
                                               "favoriteRank", "lastUsedDate",     "trashed"};
    ItemPatch patch;
    if (body.empty())
        return ApiReply::badRequest(
            "nothing to change: give filename, parentIdentifier, tags, "
            "favoriteRank, lastUsedDate or trashed");
    for (const auto& [key, value] : body.items()) {
        if (!kFields.contains(key))
            return ApiReply::badRequest("unknown field " + key);
    }
    if (body.contains("filename")) {
        const auto& value = body["filename"];
        if (!value.is_string() || value.get<std::string>().empty())
            return badField("filename", "a non-empty string");
        patch.filename_ = value.get<std::string>();
    }
    if (body.contains("parentIdentifier")) {
        const auto& value = body["parentIdentifier"];
        if (!value.is_string() || value.get<std::string>().empty())
            return badField("parentIdentifier", "an identifier");
        patch.parent_ = RouteSupport::identifierFrom(value.get<std::string>());
    }
    if (body.contains("tags")) {
        const auto& value = body["tags"];
        if (!value.is_array())
            return badField("tags", "an array of labels");
        std::vector<std::string> labels;
        std::set<std::string> seen;
        for (const auto& label : value) {
            if (!label.is_string())
                return badField("tags", "an array of labels");
            // An empty label is no tag; a label given twice is one, where it first appeared.
            auto text = label.get<std::string>();
            if (!text.empty() && seen.insert(text).second)
                labels.push_back(text);
        }
        patch.tags_ = std::move(labels);
    }
    if (body.contains("favoriteRank")) {
        const auto& value = body["favoriteRank"];
        patch.setRank_ = true;
        if (value.is_number_integer()) {
            patch.rank_ = Number::fromInt64(value.get<int64_t>());
        } else if (value.is_number_float() && std::isfinite(value.get<double>()) &&
                   std::trunc(value.get<double>()) == value.get<double>() &&
                   std::fabs(value.get<double>()) < 9.0e18) {
            patch.rank_ = Number::fromInt64(static_cast<int64_t>(value.get<double>()));
        } else if (!value.is_null()) {
            return badField("favoriteRank", "an integer or null");
        }
    }
    if (body.contains("lastUsedDate")) {
        const auto& value = body["lastUsedDate"];
        patch.setLastUsed_ = true;
        if (value.is_string() && value.get<std::string>() == "now") {
            patch.lastUsed_ = Date::now();
        } else if (value.is_string()) {
            auto seconds = RouteSupport::parseIso8601(value.get<std::string>());
            if (!seconds)
                return badField("lastUsedDate", "an ISO 8601 date, \"now\" or null");
            patch.lastUsed_ = Date::make(*seconds);
        } else if (!value.is_null()) {
            return badField("lastUsedDate", "an ISO 8601 date, \"now\" or null");
        }
    }
    if (body.contains("trashed")) {
        const auto& value = body["trashed"];
        if (!value.is_boolean())
            return badField("trashed", "true or false");
        patch.trashed_ = value.get<bool>();
        if (*patch.trashed_ && patch.parent_)
            return ApiReply::badRequest("trashed: true takes no parentIdentifier");
    }
    return patch;
}

Result<HostPorterItemRef> ItemPatch::apply(HostPorterExtension& provider,
                                           const HostPorterItemIdentifier& identifier) const {
    HostPorterItemIdentifier current = identifier;
    std::optional<Result<HostPorterItemRef>> last;
    // Runs one change on the item as the previous one left it; false on failure.
    auto step = [&](auto&& start) {
        last = ProviderCalls::waitForItem(start);
        if (!last->ok())
            return false;
        if (last->value())
            current = last->value()->itemIdentifier();
        return true;
    };
    bool renamedByMove = false;
    if (trashed_ && *trashed_) {
        if (!step([&](auto done) { provider.trashItemWithIdentifier(current, std::move(done)); }))
            return *last;
    } else if (trashed_) {
        if (!step([&](auto done) {
                provider.untrashItemWithIdentifier(current, parent_, std::move(done));
            }))
            return *last;
    } else if (parent_) {
        renamedByMove = filename_.has_value();
        if (!step([&](auto done) {
                provider.reparentItemWithIdentifier(current, *parent_, filename_, std::move(done));
            }))
            return *last;
    }
    if (filename_ && !renamedByMove) {
        if (!step([&](auto done) {
                provider.renameItemWithIdentifier(current, *filename_, std::move(done));
            }))
            return *last;
    }
    if (tags_) {
        std::optional<Bytes> data;
        if (!tags_->empty()) {
            std::vector<std::shared_ptr<const Tag>> tags;
            for (const auto& label : *tags_) tags.push_back(Tag::make(label));
            data = GetTagsDataForTags(tags);
        }
        if (!step([&](auto done) { provider.setTagData(data, current, std::move(done)); }))
            return *last;
    }
    if (setRank_) {
        if (!step([&](auto done) { provider.setFavoriteRank(rank_, current, std::move(done)); }))
            return *last;
    }
    if (setLastUsed_) {
        if (!step(
                [&](auto done) { provider.setLastUsedDate(lastUsed_, current, std::move(done)); }))
            return *last;
    }
    return *last;
}

}  // namespace tamber
