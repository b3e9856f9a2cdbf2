#include "host/ItemIdentifier.h"
#include "items/ItemMetadata.h"
#include "provider/LocalPorter.h"
#include "support/Error.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

// The error a metadata update answers with when its write failed: says what could not be
// changed on which item, keeps the cause's domain and code.
Error updateFailed(const Error& cause, const std::string& what,
                   const HostPorterItemIdentifier& identifier) {
    std::map<std::string, std::string> info = cause.userInfo();
    info["description"] = "can't " + what + " of " + identifier + ": " + cause.reason();
    info["itemIdentifier"] = identifier;
    return Error(cause.domain(), cause.code(), std::move(info));
}

}  // namespace

void LocalPorter::setLastUsedDate(std::shared_ptr<const Date> date,
                                  const HostPorterItemIdentifier& identifier,
                                  ItemCompletion completion) {
    std::string title =
        date ? "set last used date \"" + date->description() + "\" to item \"" + identifier
             : "clearing last used date for item \"" + identifier;
    withLogSection(title, [&] {
        // Libraries and other "#" items are the apps', not the user's documents.
        if (ItemIdentifier::parse(identifier).isAppLibrary()) {
            Error refused = Error::invalidParameter("itemIdentifier", identifier);
            std::map<std::string, std::string> info = refused.userInfo();
            info["description"] = "an app library has no last-used date: " + identifier;
            return completion(Error(refused.domain(), refused.code(), std::move(info)));
        }
        auto url = urlForIdentifierLogged(identifier);
        if (!url.ok())
            return completion(url.error());
        // Logged by the writer.
        if (auto status = ItemMetadata::writeLastUsedDate(url.value(), date); !status.ok())
            return completion(updateFailed(status.error(), "set the last-used date", identifier));
        completion(itemForURL(url.value()));
    });
}

void LocalPorter::setTagData(const std::optional<Bytes>& tagData,
                             const HostPorterItemIdentifier& identifier,
                             ItemCompletion completion) {
    withLogSection("set tag data to item \"" + identifier, [&] {
        auto url = urlForIdentifierLogged(identifier);
        if (!url.ok()) {
            logError("can't find URL for item; " + url.error().description());
            return completion(Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        }
        // Logged by the writer; no tags is written as an empty list, never a removal.
        if (auto error = ItemMetadata::writeTagData(url.value(), tagData); !error.ok())
            return completion(updateFailed(error.error(), "set the tags", identifier));
        completion(itemForURL(url.value()));
    });
}

void LocalPorter::setFavoriteRank(std::shared_ptr<const Number> rank,
                                  const HostPorterItemIdentifier& identifier,
                                  ItemCompletion completion) {
    withLogSection(
        "set favorite rank \"" + (rank ? rank->description() : std::string("nil")) +
            "\" to item \"" + identifier,
        [&] {
            auto url = urlForIdentifierLogged(identifier);
            if (!url.ok()) {
                logError("can't find URL for item; " + url.error().description());
                return completion(Error::porterErrorForNonExistentItemWithIdentifier(identifier));
            }
            if (auto error = ItemMetadata::writeFavoriteRank(url.value(), rank); !error.ok())
                return completion(
                    updateFailed(error.error(), "set the favourite rank", identifier));
            completion(itemForURL(url.value()));
        });
}

Status LocalPorter::changeMetadataAtURL(const Url& url, const MetadataChanges& changes) {
    if (changes.favoriteRank)
        if (auto error = ItemMetadata::writeFavoriteRank(url, *changes.favoriteRank); !error.ok())
            return error;
    if (changes.lastUsedDate)
        if (auto error = ItemMetadata::writeLastUsedDate(url, *changes.lastUsedDate); !error.ok())
            return error;
    if (changes.tagData)
        if (auto error = ItemMetadata::writeTagData(url, *changes.tagData); !error.ok())
            return error;
    return Status::OK();
}

ItemMetadata LocalPorter::metadataAtURL(const Url& url) {
    return ItemMetadata::read(url);
}

}  // namespace tamber
