#include <cerrno>

#include "host/UrlOperations.h"
#include "items/ExtendedAttributes.h"
#include "items/ItemMetadata.h"
#include "platform/Tag.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/objects/Array.h"
#include "platform/objects/String.h"
#include "provider/LocalPorter.h"
#include "support/Error.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

// Sets (or, for nothing, removes) one attribute through the item's read-write access. A
// failure is logged with the attribute's name and handed back: a caller that asked for a
// change must learn that it did not happen.
Status writeAttribute(const Url& url, const ObjectRef& value, const std::string& name) {
    std::optional<Bytes> data;
    if (value) {
        auto archived = KeyedArchiver::archivedDataWithRootObject(value);
        if (!archived.ok()) {
            logError("can't archive value for xattr " + name + "; " +
                     archived.error().description());
            return archived.error();
        }
        data = std::move(archived.value());
    }
    Status written;
    if (!pt_withReadWriteAccess(url, [&](int fd) {
            written = SetOrRemoveXattr(fd, data, name);
            return written.ok();
        })) {
        Error error = written.ok() ? Error::errorWithPOSIXCode(errno) : written.error();
        logError("can't set xattr " + name + "; " + error.description());
        return error;
    }
    return Status::OK();
}

// The error a metadata update answers with when its write failed: says what could not be
// changed on which item, keeps the cause's domain and code.
Error updateFailed(const Error& cause, const std::string& what,
                   const HostPorterItemIdentifier& identifier) {
    std::map<std::string, std::string> info = cause.userInfo();
    info["description"] = "can't " + what + " of " + identifier + ": " + cause.reason();
    info["itemIdentifier"] = identifier;
    return Error(cause.domain(), cause.code(), std::move(info));
}

// The labels of tag data, in order; nothing readable gives none. Colours are not kept.
std::vector<ObjectRef> labelsOf(const std::optional<Bytes>& tagData) {
    std::vector<ObjectRef> labels;
    if (!tagData)
        return labels;
    if (auto tags = GetTagsFromTagsData(*tagData)) {
        labels.reserve(tags->size());
        for (const auto& tag : *tags) labels.push_back(String::make(tag->label()));
    }
    return labels;
}

void completeWithItem(LocalPorter& porter, const Url& url,
                      const LocalPorter::ItemCompletion& completion) {
    auto item = porter.itemForURL(url);
    if (!item.ok())
        return completion(item.error());
    completion(item.value());
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
        if (identifier.find('#') != std::string::npos) {
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
        completeWithItem(*this, url.value(), completion);
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
        // Never removed: no tags is an empty list, so that clearing them is a change too.
        if (auto status = writeAttribute(url.value(), Array::make(labelsOf(tagData)),
                                         LocalItem::xattrTagDataName());
            !status.ok())
            return completion(updateFailed(status.error(), "set the tags", identifier));
        completeWithItem(*this, url.value(), completion);
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
            if (auto status = writeAttribute(url.value(), rank, LocalItem::xattrFavoriteRankName());
                !status.ok())
                return completion(
                    updateFailed(status.error(), "set the favourite rank", identifier));
            completeWithItem(*this, url.value(), completion);
        });
}

}  // namespace tamber
