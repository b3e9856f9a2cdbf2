#include "host/ItemIdentifier.h"
#include "host/UrlOperations.h"
#include "provider/LocalPorter.h"
#include "support/Error.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

// The root holds only the app libraries and the shared area: nothing is created in it or moved
// into it.
bool isRootContainer(const HostPorterItemIdentifier& identifier) {
    return identifier == HostPorterRootContainerItemIdentifier;
}

// The containers themselves (the root, whose URL is the document storage, and the app
// libraries, which belong to their apps) are never renamed, moved or removed, whatever a caller
// asks: their records don't offer it, and the files below them would go too.
bool isFixedContainer(const HostPorterItemIdentifier& identifier) {
    auto kind = ItemIdentifier::parse(identifier).kind();
    return isRootContainer(identifier) || kind == ItemIdentifier::Kind::WorkingSet ||
           kind == ItemIdentifier::Kind::AllDirectories || kind == ItemIdentifier::Kind::AppLibrary;
}

// Turns the outcome of a host file operation into the completion of an item operation.
void finishWithItem(LocalPorter& porter, const std::optional<Url>& url,
                    const std::optional<Error>& error,
                    const LocalPorter::ItemCompletion& completion) {
    if (error || !url) {
        completion(nullptr, error.value_or(Error::posix(EIO)));
        return;
    }
    auto item = porter.itemForURL(*url);
    if (!item.ok()) {
        completion(nullptr, item.error());
        return;
    }
    completion(item.value(), std::nullopt);
}

}  // namespace

void LocalPorter::importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                                      ItemCompletion completion) {
    withLogSection("import document at \"" + source.path() + "\" to parent \"" + parent + "\"",
                   [&] {
                       if (isRootContainer(parent))
                           return completion(nullptr, Error::errorFileWriteNoPermission());
                       auto folder = urlForIdentifierLogged(parent);
                       if (!folder.ok())
                           return completion(nullptr, folder.error());
                       pt_importUnderFolder(
                           source, folder.value(),
                           [this, completion](std::optional<Url> url, std::optional<Error> error) {
                               finishWithItem(*this, url, error, completion);
                           });
                   });
}

void LocalPorter::createDirectoryWithName(const std::string& name,
                                          const HostPorterItemIdentifier& parent,
                                          ItemCompletion completion) {
    createDirectoryWithName(name, parent, true, std::move(completion));
}

void LocalPorter::createDirectoryWithName(const std::string& name,
                                          const HostPorterItemIdentifier& parent, bool bounce,
                                          ItemCompletion completion) {
    withLogSection("create directory with name \"" + name + "\" in parent \"" + parent + "\"", [&] {
        if (isRootContainer(parent))
            return completion(nullptr, Error::errorFileWriteNoPermission());
        auto folder = urlForIdentifierLogged(parent);
        if (!folder.ok())
            return completion(nullptr, folder.error());
        pt_createSubFolder(folder.value(), name, bounce,
                           [this, completion](std::optional<Url> url, std::optional<Error> error) {
                               finishWithItem(*this, url, error, completion);
                           });
    });
}

void LocalPorter::renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                           const std::string& name, ItemCompletion completion) {
    withLogSection("rename item \"" + identifier + "\" to name \"" + name + "\"", [&] {
        if (isFixedContainer(identifier))
            return completion(nullptr, Error::errorFileWriteNoPermission());
        auto url = urlForIdentifierLogged(identifier);
        if (!url.ok())
            return completion(nullptr, url.error());
        pt_renameWithNewName(
            url.value(), name,
            [this, completion](std::optional<Url> renamed, std::optional<Error> error) {
                finishWithItem(*this, renamed, error, completion);
            });
    });
}

void LocalPorter::reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                             const HostPorterItemIdentifier& parent,
                                             const std::optional<std::string>& newName,
                                             ItemCompletion completion) {
    withLogSection("move item \"" + identifier + "\" to parent \"" + parent + "\"", [&] {
        if (isRootContainer(parent) || isFixedContainer(identifier))
            return completion(nullptr, Error::errorFileWriteNoPermission());
        auto url = _urlForItemWithPersistentIdentifier(identifier);
        if (!url)
            return completion(nullptr,
                              Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        auto folder = _urlForItemWithPersistentIdentifier(parent);
        if (!folder)
            return completion(nullptr, Error::porterErrorForNonExistentItemWithIdentifier(parent));
        pt_reparentUnderFolder(
            *url, *folder, newName,
            [this, completion](std::optional<Url> moved, std::optional<Error> error) {
                finishWithItem(*this, moved, error, completion);
            });
    });
}

void LocalPorter::deleteItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                           ErrorCompletion completion) {
    withLogSection("delete item \"" + identifier + "\"", [&] {
        if (isFixedContainer(identifier))
            return completion(Error::errorFileWriteNoPermission());
        auto url = _urlForItemWithPersistentIdentifier(identifier);
        if (!url)
            return completion(Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        pt_deleteWithCompletionHandler(
            *url, [completion](std::optional<Error> error) { completion(error); });
    });
}

}  // namespace tamber
