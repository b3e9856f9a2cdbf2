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

}  // namespace

void LocalPorter::importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                                      ItemCompletion completion) {
    withLogSection(
        "import document at \"" + source.path() + "\" to parent \"" + parent + "\"", [&] {
            if (isRootContainer(parent))
                return completion(Error::errorFileWriteNoPermission());
            auto folder = urlForIdentifierLogged(parent);
            if (!folder.ok())
                return completion(folder.error());
            pt_importUnderFolder(source, folder.value(), [this, completion](Result<Url> url) {
                finishWithItem(url, removeMade(), completion);
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
            return completion(Error::errorFileWriteNoPermission());
        auto folder = urlForIdentifierLogged(parent);
        if (!folder.ok())
            return completion(folder.error());
        pt_createSubFolder(folder.value(), name, bounce, [this, completion](Result<Url> url) {
            finishWithItem(url, removeMade(), completion);
        });
    });
}

void LocalPorter::renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                           const std::string& name, ItemCompletion completion) {
    withLogSection("rename item \"" + identifier + "\" to name \"" + name + "\"", [&] {
        if (isFixedContainer(identifier))
            return completion(Error::errorFileWriteNoPermission());
        auto url = urlForIdentifierLogged(identifier);
        if (!url.ok())
            return completion(url.error());
        Url original = url.value();
        pt_renameWithNewName(original, name, [this, original, completion](Result<Url> renamed) {
            finishWithItem(renamed, moveBackTo(original), completion);
        });
    });
}

void LocalPorter::reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                             const HostPorterItemIdentifier& parent,
                                             const std::optional<std::string>& newName,
                                             ItemCompletion completion) {
    withLogSection("move item \"" + identifier + "\" to parent \"" + parent + "\"", [&] {
        if (isRootContainer(parent) || isFixedContainer(identifier))
            return completion(Error::errorFileWriteNoPermission());
        auto url = _urlForItemWithPersistentIdentifier(identifier);
        if (!url)
            return completion(Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        auto folder = _urlForItemWithPersistentIdentifier(parent);
        if (!folder)
            return completion(Error::porterErrorForNonExistentItemWithIdentifier(parent));
        Url original = *url;
        pt_reparentUnderFolder(original, *folder, newName,
                               [this, original, completion](Result<Url> moved) {
                                   finishWithItem(moved, moveBackTo(original), completion);
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
        pt_deleteWithCompletionHandler(*url, completion);
    });
}

}  // namespace tamber
