#include "cli/RemoteEnumerator.h"

#include <cerrno>
#include <utility>
#include <vector>

#include "cli/RemoteItem.h"
#include "cli/ServerClient.h"
#include "runtime/Base64.h"

namespace tamber {

namespace {

Error malformed(const std::string& what) {
    return Error(kPosixErrorDomain, EPROTO,
                 {{"description", "the Tamber server sent a malformed " + what}});
}

// The bytes of a base64 value; nothing when it is missing or not base64.
std::optional<Bytes> decoded(const nlohmann::json& value) {
    if (!value.is_string())
        return std::nullopt;
    return base64Decode(value.get<std::string>());
}

}  // namespace

RemoteEnumerator::RemoteEnumerator(std::shared_ptr<ServerClient> client,
                                   HostPorterItemIdentifier container,
                                   std::optional<HostPorterSyncAnchor> anchor)
    : client_(std::move(client)), container_(std::move(container)), anchor_(std::move(anchor)) {}

std::string RemoteEnumerator::containerPath() const {
    return "containers/" + ServerClient::encode(container_);
}

void RemoteEnumerator::enumerateItemsForObserver(
    std::shared_ptr<HostPorterEnumerationObserver> observer, const HostPorterPage& page) {
    std::string path = containerPath() + "/children";
    // The first page by name is where a listing starts; the server starts there by itself.
    if (page != HostPorterInitialPageSortedByName())
        path += "?page=" + ServerClient::encode(base64Encode(page));
    auto answer = client_->get(path);
    if (!answer.ok())
        return observer->finishEnumeratingWithError(answer.error());
    const nlohmann::json& body = answer.value();
    if (!body.is_object() || !body.contains("items") || !body["items"].is_array())
        return observer->finishEnumeratingWithError(malformed("page"));
    std::vector<HostPorterItemRef> items;
    for (const auto& record : body["items"]) {
        auto item = RemoteItem::fromJson(record);
        if (!item.ok())
            return observer->finishEnumeratingWithError(item.error());
        items.push_back(item.value());
    }
    std::optional<HostPorterPage> next;
    if (auto found = body.find("nextPage"); found != body.end() && !found->is_null()) {
        next = decoded(*found);
        if (!next)
            return observer->finishEnumeratingWithError(malformed("page token"));
    }
    if (!items.empty())
        observer->didEnumerateItems(items);
    observer->finishEnumeratingUpToPage(next);
}

void RemoteEnumerator::enumerateChangesForObserver(
    std::shared_ptr<HostPorterChangeObserver> observer, const HostPorterSyncAnchor& anchor) {
    auto answer = client_->get(containerPath() +
                               "/changes?anchor=" + ServerClient::encode(base64Encode(anchor)));
    if (!answer.ok())
        return observer->finishEnumeratingWithError(answer.error());
    const nlohmann::json& body = answer.value();
    if (!body.is_object() || !body.contains("changes") || !body["changes"].is_array())
        return observer->finishEnumeratingWithError(malformed("batch of changes"));
    // Replayed one by one, in the order the server sent them: a deletion and an update of the
    // same identifier must stay in that order.
    for (const auto& change : body["changes"]) {
        if (change.contains("updated")) {
            auto item = RemoteItem::fromJson(change["updated"]);
            if (!item.ok())
                return observer->finishEnumeratingWithError(item.error());
            observer->didUpdateItems({item.value()});
        } else if (change.contains("deleted") && change["deleted"].is_string()) {
            observer->didDeleteItemsWithIdentifiers({change["deleted"].get<std::string>()});
        } else {
            return observer->finishEnumeratingWithError(malformed("change"));
        }
    }
    std::optional<Bytes> next = decoded(body.value("anchor", nlohmann::json()));
    if (!next)
        return observer->finishEnumeratingWithError(malformed("sync anchor"));
    observer->finishEnumeratingChangesUpToSyncAnchor(*next, body.value("moreComing", false));
}

void RemoteEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<HostPorterSyncAnchor>)> completion) {
    {
        std::lock_guard lock(mutex_);
        if (anchor_)
            return completion(std::exchange(anchor_, std::nullopt));
    }
    auto answer = client_->get(containerPath() + "/anchor");
    if (!answer.ok() || !answer.value().is_object())
        return completion(std::nullopt);
    completion(decoded(answer.value().value("anchor", nlohmann::json())));
}

}  // namespace tamber
