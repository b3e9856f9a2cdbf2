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
// failure is logged with the attribute's name only; the caller still answers with the item,
// whose record then shows what is really on disk.
void writeAttribute(const Url& url, const ObjectRef& value, const std::string& name) {
    std::optional<Bytes> data;
    if (value) {
        auto archived = KeyedArchiver::archivedDataWithRootObject(value);
        if (!archived.ok()) {
            logError("can't archive value for xattr " + name + "; " +
                     archived.error().description());
            return;
        }
        data = std::move(archived.value());
    }
    if (!pt_withReadWriteAccess(url, [&](int fd) { return !SetOrRemoveXattr(fd, data, name); })) {
        Error error = Error::errorWithPOSIXCode(errno);
        logError("can't set xattr " + name + "; " + error.description());
    }
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
        return completion(nullptr, item.error());
    completion(item.value(), std::nullopt);
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
        if (identifier.find('#') != std::string::npos)
            return completion(nullptr, Error::invalidParameter("itemIdentifier", identifier));
        auto url = urlForIdentifierLogged(identifier);
        if (!url.ok())
            return completion(nullptr, url.error());
        // Logged by the writer; the answer is the item as it now is.
        (void)ItemMetadata::writeLastUsedDate(url.value(), date);
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
            return completion(nullptr,
                              Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        }
        // Never removed: no tags is an empty list, so that clearing them is a change too.
        writeAttribute(url.value(), Array::make(labelsOf(tagData)), LocalItem::xattrTagDataName());
        completeWithItem(*this, url.value(), completion);
    });
}

void LocalPorter::setFavoriteRank(std::shared_ptr<const Number> rank,
                                  const HostPorterItemIdentifier& identifier,
                                  ItemCompletion completion) {
    withLogSection("set favorite rank \"" + (rank ? rank->description() : std::string("nil")) +
                       "\" to item \"" + identifier,
                   [&] {
                       auto url = urlForIdentifierLogged(identifier);
                       if (!url.ok()) {
                           logError("can't find URL for item; " + url.error().description());
                           return completion(
                               nullptr,
                               Error::porterErrorForNonExistentItemWithIdentifier(identifier));
                       }
                       writeAttribute(url.value(), rank, LocalItem::xattrFavoriteRankName());
                       completeWithItem(*this, url.value(), completion);
                   });
}

}  // namespace tamber
