#include "runtime/HostJson.h"

#include <algorithm>

#include "applibraries/LocalAppLibraryManager.h"
#include "host/PublishedTrees.h"
#include "items/LocalAppLibraryItem.h"
#include "items/LocalItem.h"
#include "platform/Tag.h"
#include "runtime/Base64.h"
#include "runtime/JsonValues.h"
#include "runtime/RecordedItem.h"

namespace tamber {

namespace {

nlohmann::json tagsJson(const HostPorterItem& item) {
    nlohmann::json labels = nlohmann::json::array();
    if (auto data = item.tagData()) {
        if (auto tags = GetTagsFromTagsData(*data))
            for (const auto& tag : *tags) labels.push_back(validUtf8(tag->label()));
    }
    return labels;
}

}  // namespace

nlohmann::json HostJson::item(const HostPorterItem& item) {
    if (const auto* recorded = dynamic_cast<const RecordedItem*>(&item))
        return recorded->record();
    nlohmann::json json{{"identifier", validUtf8(item.itemIdentifier())},
                        {"parentIdentifier", validUtf8(item.parentItemIdentifier())},
                        {"typeIdentifier", item.typeIdentifier()},
                        {"documentSize", numberJson(item.documentSize())},
                        {"creationDate", dateJson(item.creationDate())},
                        {"contentModificationDate", dateJson(item.contentModificationDate())},
                        {"childItemCount", numberJson(item.childItemCount())},
                        {"capabilities", item.capabilities()},
                        {"tags", tagsJson(item)},
                        {"favoriteRank", numberJson(item.favoriteRank())},
                        {"lastUsedDate", dateJson(item.lastUsedDate())},
                        {"trashed", item.isTrashed()}};
    // Names are bytes: one that is not UTF-8 is shown with U+FFFD and given exactly beside it.
    setTextWithBytes(json, "filename", "filenameBytes", item.filename());
    if (const auto* local = dynamic_cast<const LocalItem*>(&item))
        setTextWithBytes(json, "path", "pathBytes", local->fileURL().path());
    return json;
}

nlohmann::json HostJson::page(const std::vector<HostPorterItemRef>& items,
                              const std::optional<HostPorterPage>& nextPage) {
    nlohmann::json list = nlohmann::json::array();
    for (const auto& entry : items)
        if (entry)
            list.push_back(item(*entry));
    return {{"items", std::move(list)},
            {"nextPage", nextPage ? nlohmann::json(base64Encode(*nextPage)) : nullptr}};
}

nlohmann::json HostJson::changeBatch(const ChangeCollector::Batch& batch) {
    nlohmann::json updated = nlohmann::json::array();
    nlohmann::json changes = nlohmann::json::array();
    for (const auto& change : batch.changes) {
        if (change.item) {
            updated.push_back(item(*change.item));
            changes.push_back({{"updated", item(*change.item)}});
        } else {
            changes.push_back({{"deleted", change.deletedItem}});
        }
    }
    return {{"updated", std::move(updated)},
            {"deleted", batch.deleted},
            {"changes", std::move(changes)},
            {"anchor", batch.anchor ? base64Encode(*batch.anchor) : std::string()},
            {"moreComing", batch.moreComing}};
}

nlohmann::json HostJson::journalEvent(const JournalEvent& event) {
    nlohmann::json json{
        {"id", event.id},
        {"flags", event.flags},
        {"fileID", event.fileID ? nlohmann::json(event.fileID) : nlohmann::json(nullptr)}};
    setTextWithBytes(json, "path", "pathBytes", event.path);
    return json;
}

std::optional<JournalEvent> HostJson::journalEventFromJson(const nlohmann::json& json) {
    if (!json.is_object())
        return std::nullopt;
    auto id = json.find("id");
    auto flags = json.find("flags");
    auto fileID = json.find("fileID");
    auto path = json.find("path");
    if (id == json.end() || !id->is_number_unsigned() || flags == json.end() ||
        !flags->is_number_unsigned() || fileID == json.end() ||
        !(fileID->is_null() || fileID->is_number_unsigned()) || path == json.end() ||
        !path->is_string())
        return std::nullopt;
    JournalEvent event;
    event.id = id->get<uint64_t>();
    event.flags = flags->get<uint32_t>();
    event.fileID = fileID->is_null() ? 0 : fileID->get<uint64_t>();
    event.path = path->get<std::string>();
    if (auto bytes = json.find("pathBytes"); bytes != json.end() && bytes->is_string()) {
        auto decoded = base64Decode(bytes->get<std::string>());
        if (!decoded)
            return std::nullopt;
        event.path.assign(decoded->begin(), decoded->end());
    }
    return event;
}

namespace {

// The mark the command line puts on errors made from bad input (CliContext::usageError).
constexpr const char* kUsageKey = "usage";

}  // namespace

nlohmann::json HostJson::appLibraries() {
    auto manager = LocalAppLibraryManager::shared();
    auto items = manager->allItems();
    std::sort(items.begin(), items.end(), [](const auto& a, const auto& b) {
        return a->itemIdentifier() < b->itemIdentifier();
    });
    nlohmann::json libraries = nlohmann::json::array();
    for (const auto& item : items) {
        // The record's own bundle identifier: null when it has none, not "(null)".
        const auto& bundle = item->pt_appContainerBundleIdentifier();
        libraries.push_back({{"identifier", item->itemIdentifier()},
                             {"name", item->filename()},
                             {"bundleIdentifier", bundle ? nlohmann::json(*bundle) : nullptr},
                             {"root", item->fileURL().path()}});
    }
    return {{"versionToken", manager->versionToken()}, {"libraries", libraries}};
}

nlohmann::json HostJson::error(const Error& error) {
    nlohmann::json body{
        {"domain", error.domain()}, {"code", error.code()}, {"message", error.reason()}};
    if (error.userInfo().contains(kUsageKey))
        body["usage"] = true;
    if (PublishedTrees::isOutsideError(error))
        body["outside"] = true;
    return {{"error", std::move(body)}};
}

std::optional<Error> HostJson::errorFromJson(const nlohmann::json& json) {
    if (!json.is_object() || !json.contains("error") || !json["error"].is_object())
        return std::nullopt;
    const nlohmann::json& body = json["error"];
    auto domain = body.find("domain");
    auto code = body.find("code");
    auto message = body.find("message");
    if (domain == body.end() || !domain->is_string() || code == body.end() ||
        !code->is_number_integer() || message == body.end() || !message->is_string())
        return std::nullopt;
    std::map<std::string, std::string> info;
    if (body.value("outside", false)) {
        // The refusal's own mark, which only PublishedTrees knows how to make.
        info = PublishedTrees::outsideError(Url()).userInfo();
    }
    if (body.value("usage", false))
        info.insert_or_assign(std::string(kUsageKey), std::string(1, '1'));
    info.insert_or_assign(std::string("description"), message->get<std::string>());
    return Error(domain->get<std::string>(), code->get<int64_t>(), std::move(info));
}

}  // namespace tamber
