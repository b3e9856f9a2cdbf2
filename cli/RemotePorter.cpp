#include "cli/RemotePorter.h"
#include "runtime/Duration.h"

#include <cerrno>
#include <cmath>
#include <utility>

#include "cli/RemoteEnumerator.h"
#include "cli/RemoteItem.h"
#include "cli/ServerClient.h"
#include "platform/Tag.h"
#include "runtime/Base64.h"
#include "runtime/JsonValues.h"

namespace tamber {

RemotePorter::RemotePorter(std::shared_ptr<ServerClient> client) : client_(std::move(client)) {}

std::string RemotePorter::itemPath(const HostPorterItemIdentifier& identifier) {
    return "items/" + ServerClient::encode(identifier);
}

Result<HostPorterItemRef> RemotePorter::itemFrom(const Result<nlohmann::json>& answer) {
    if (!answer.ok())
        return answer.error();
    return RemoteItem::fromJson(answer.value());
}

Result<HostPorterItemRef> RemotePorter::itemForIdentifier(
    const HostPorterItemIdentifier& identifier) {
    return itemFrom(client_->get(itemPath(identifier)));
}

std::optional<Url> RemotePorter::URLForItemWithPersistentIdentifier(
    const HostPorterItemIdentifier& identifier) {
    auto answer = client_->get(itemPath(identifier) + "/path");
    if (!answer.ok() || !answer.value().is_object())
        return std::nullopt;
    // The exact bytes when the text had to be repaired.
    if (auto bytes = answer.value().find("pathBytes");
        bytes != answer.value().end() && bytes->is_string()) {
        if (auto decoded = base64Decode(bytes->get<std::string>()))
            return Url::fileURLWithPath(std::string(decoded->begin(), decoded->end()));
    }
    auto path = answer.value().find("path");
    if (path == answer.value().end() || !path->is_string())
        return std::nullopt;
    return Url::fileURLWithPath(path->get<std::string>());
}

std::optional<HostPorterItemIdentifier> RemotePorter::persistentIdentifierForItemAtURL(
    const Url& url) {
    auto answer = client_->get("identifiers?path=" + ServerClient::encode(url.path()));
    if (!answer.ok() || !answer.value().is_object())
        return std::nullopt;
    auto identifier = answer.value().find("identifier");
    if (identifier == answer.value().end() || !identifier->is_string())
        return std::nullopt;
    return identifier->get<std::string>();
}

Result<HostPorterItemRef> RemotePorter::itemAtURL(const Url& url) {
    return itemFrom(client_->get("lookup?path=" + ServerClient::encode(url.path())));
}

Result<HostPorterEnumeratorRef> RemotePorter::enumeratorForContainerItemIdentifier(
    const HostPorterItemIdentifier& identifier) {
    if (isHostContainerIdentifier(identifier))
        return HostPorterEnumeratorRef(std::make_shared<RemoteEnumerator>(client_, identifier));
    // Asking for the anchor makes the server create the enumerator, so a container that cannot
    // be listed (missing, a file, outside) fails here, as it does directly; the anchor is kept
    // for a caller that wants it.
    auto answer = client_->get("containers/" + ServerClient::encode(identifier) + "/anchor");
    std::optional<HostPorterSyncAnchor> anchor;
    if (answer.ok()) {
        if (answer.value().is_object() && answer.value().contains("anchor") &&
            answer.value()["anchor"].is_string())
            anchor = base64Decode(answer.value()["anchor"].get<std::string>());
    } else if (!answer.error().is(kPosixErrorDomain, EIO)) {
        // A volume without a journal has no anchor but can still be listed.
        return answer.error();
    }
    return HostPorterEnumeratorRef(
        std::make_shared<RemoteEnumerator>(client_, identifier, std::move(anchor)));
}

void RemotePorter::importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                                       ItemCompletion completion) {
    completion(itemFrom(client_->post("containers/" + ServerClient::encode(parent) + "/children",
                                      {{"import", source.path()}})));
}

void RemotePorter::createDirectoryWithName(const std::string& name,
                                           const HostPorterItemIdentifier& parent, bool bounce,
                                           ItemCompletion completion) {
    // A name that is not UTF-8 cannot travel in JSON text; the server refuses such a name anyway.
    if (!isValidUtf8(name))
        return completion(Error::invalidParameter("name", validUtf8(name)));
    completion(itemFrom(client_->post("containers/" + ServerClient::encode(parent) + "/children",
                                      {{"folder", name}, {"bounce", bounce}})));
}

void RemotePorter::patch(const HostPorterItemIdentifier& identifier, const nlohmann::json& changes,
                         ItemCompletion& completion) {
    completion(itemFrom(client_->patch(itemPath(identifier), changes)));
}

void RemotePorter::renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                            const std::string& name, ItemCompletion completion) {
    if (!isValidUtf8(name))
        return completion(Error::invalidParameter("filename", validUtf8(name)));
    patch(identifier, {{"filename", name}}, completion);
}

void RemotePorter::reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                              const HostPorterItemIdentifier& parent,
                                              const std::optional<std::string>& newName,
                                              ItemCompletion completion) {
    nlohmann::json changes{{"parentIdentifier", parent}};
    if (newName) {
        if (!isValidUtf8(*newName))
            return completion(Error::invalidParameter("filename", validUtf8(*newName)));
        changes["filename"] = *newName;
    }
    patch(identifier, changes, completion);
}

void RemotePorter::deleteItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                            ErrorCompletion completion) {
    auto answer = client_->remove(itemPath(identifier));
    completion(answer.ok() ? Status::OK() : Status(answer.error()));
}

void RemotePorter::trashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                           ItemCompletion completion) {
    patch(identifier, {{"trashed", true}}, completion);
}

void RemotePorter::untrashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                             const std::optional<HostPorterItemIdentifier>& parent,
                                             ItemCompletion completion) {
    nlohmann::json changes{{"trashed", false}};
    if (parent)
        changes["parentIdentifier"] = *parent;
    patch(identifier, changes, completion);
}

void RemotePorter::removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                                   std::function<void(size_t removed)> completion) {
    double age = referenceDate
                     ? Date::now()->timeIntervalSince1970() - referenceDate->timeIntervalSince1970()
                     : 0;
    auto seconds = static_cast<uint64_t>(std::llround(std::max(0.0, age)));
    auto answer =
        client_->post("trash/purge?olderThan=" + Duration::text(seconds), nlohmann::json::object());
    size_t removed = 0;
    if (!answer.ok())
        lastError_ = answer.error();
    else if (auto count = answer.value().find("removed");
             count != answer.value().end() && count->is_number_unsigned())
        removed = count->get<size_t>();
    completion(removed);
}

void RemotePorter::setLastUsedDate(std::shared_ptr<const Date> date,
                                   const HostPorterItemIdentifier& identifier,
                                   ItemCompletion completion) {
    patch(identifier, {{"lastUsedDate", dateJson(date)}}, completion);
}

void RemotePorter::setTagData(const std::optional<Bytes>& tagData,
                              const HostPorterItemIdentifier& identifier,
                              ItemCompletion completion) {
    nlohmann::json labels = nlohmann::json::array();
    if (tagData) {
        auto tags = GetTagsFromTagsData(*tagData);
        if (!tags)
            return completion(Error::invalidParameter("tags"));
        for (const auto& tag : *tags) labels.push_back(tag->label());
    }
    patch(identifier, {{"tags", labels}}, completion);
}

void RemotePorter::setFavoriteRank(std::shared_ptr<const Number> rank,
                                   const HostPorterItemIdentifier& identifier,
                                   ItemCompletion completion) {
    patch(identifier, {{"favoriteRank", numberJson(rank)}}, completion);
}

void RemotePorter::fetchThumbnailsForItemIdentifiers(
    const std::vector<HostPorterItemIdentifier>& identifiers, ThumbnailSize requestedSize,
    PerThumbnailCompletion perThumbnailCompletion, ErrorCompletion completion) {
    std::string query;
    if (requestedSize.width > 0)
        query = "?size=" + std::to_string(std::lround(requestedSize.width));
    for (const auto& identifier : identifiers) {
        auto png = client_->getBytes(itemPath(identifier) + "/thumbnail" + query);
        if (png.ok()) {
            perThumbnailCompletion(identifier, Bytes(png.value().begin(), png.value().end()),
                                   std::nullopt);
        } else if (png.error().is(kPosixErrorDomain, ECONNREFUSED)) {
            // No answer at all: the fetch failed, not the thumbnail.
            return completion(png.error());
        } else {
            perThumbnailCompletion(identifier, std::nullopt, png.error());
        }
    }
    completion(Status::OK());
}

void RemotePorter::defaultApplicationContainerForBundleIdentifier(
    const std::string& bundleIdentifier, ItemCompletion completion) {
    completion(itemForIdentifier("#" + bundleIdentifier));
}

void RemotePorter::refreshInstalledAppsWithCompletionHandler(std::function<void()> completion) {
    auto answer = client_->post("apps/refresh", nlohmann::json::object());
    if (!answer.ok())
        lastError_ = answer.error();
    completion();
}

}  // namespace tamber
