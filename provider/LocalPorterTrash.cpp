#include "host/ItemIdentifier.h"
#include "host/ItemNames.h"
#include "host/UrlOperations.h"
#include "items/ItemMetadata.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "provider/LocalPorter.h"
#include "provider/LocalPorterError.h"
#include "provider/TrashLocations.h"
#include "support/Error.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

std::string joinedComponents(const std::vector<std::string>& components) {
    std::string text;
    for (const auto& component : components) {
        if (!text.empty())
            text += ", ";
        text += component;
    }
    return text;
}

// Records where the item came from, relative to its library, so that it can go back there even
// if the library moved. Failures are logged only: the item stays trashed either way.
void setPutBackString(const Url& trashedURL, const Url& originalURL) {
    logDebug([&] { return "setting putback string on " + trashedURL.absoluteString(); });
    auto library = documentLibraryContaining(originalURL);
    if (!library) {
        logError("couldn't find app library for " + originalURL.absoluteString());
        return;
    }
    auto relative = pathRelativeToBase(originalURL, library->root);
    if (!relative) {
        logError("could't compute putback string (path: " + originalURL.path() +
                 ", basePath: " + library->root.path());
        return;
    }
    logDebug(
        [&] { return "setting putback '" + *relative + "' on " + trashedURL.absoluteString(); });
    if (auto error = ItemMetadata::writePutBack(trashedURL, String::make(*relative)); !error.ok())
        logError("couldn't set putback xattr (" + *relative + ") on " +
                 trashedURL.absoluteString() + "; " + error.error().description());
}

bool isReachableFolder(const Url& url) {
    auto isDirectory = url.resourceValue(ResourceKeys::kIsDirectory);
    if (!isDirectory.ok())
        return false;
    auto flag = objectCast<Number>(isDirectory.value());
    return flag && flag->boolValue();
}

}  // namespace

void LocalPorter::trashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                          ItemCompletion completion) {
    withLogSection("trash item \"" + identifier + "\"", [&] {
        auto url = _urlForItemWithPersistentIdentifier(identifier);
        if (!url)
            return completion(Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        // Trashing a library or the storage itself would move it into its own trash.
        auto kind = ItemIdentifier::parse(identifier).kind();
        if (kind == ItemIdentifier::Kind::RootContainer || kind == ItemIdentifier::Kind::AppLibrary)
            return completion(Error::errorFileWriteNoPermission());

        auto components = componentsThroughFirstDocuments(*url);
        if (!components) {
            logError("no Documents directory found in path \"" + url->path() + "\"");
            return completion(Error::invalidParameter("sourceURL", url->path()));
        }
        auto documents = urlFromPathComponents(*components);
        if (!documents) {
            logError("can't build trash URL from components \"" + joinedComponents(*components) +
                     "\"");
            return completion(
                Error::invalidParameter("trashComponents", joinedComponents(*components)));
        }
        Url trash = documents->appendingPathComponent(kTrashFolderName);
        logDebug([&] { return "trash is located at \"" + trash.path() + "\""; });
        // Made beneath the library without following links; a linked .Trash is refused
        // before anything moves.
        if (auto status = pt_ensureTrashFolder(trash); !status.ok())
            return completion(status.error());

        Url original = *url;
        pt_trashUnderFolder(original, trash, [this, original, completion](Result<Url> trashed) {
            if (!trashed.ok())
                return completion(trashed.error());
            // The move stands whatever happens to the attributes.
            (void)ItemMetadata::writeTrashDate(trashed.value(), Date::now());
            setPutBackString(trashed.value(), original);
            ChangeUndo moveBack = moveBackTo(original);
            finishWithItem(
                trashed,
                [moveBack](const Url& url, std::function<void()> done) {
                    (void)ItemMetadata::writeTrashDate(url, nullptr);
                    (void)ItemMetadata::writePutBack(url, nullptr);
                    moveBack(url, std::move(done));
                },
                completion);
        });
    });
}

void LocalPorter::untrashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                            const std::optional<HostPorterItemIdentifier>& parent,
                                            ItemCompletion completion) {
    withLogSection("untrash item \"" + identifier + "\"", [&] {
        auto url = _urlForItemWithPersistentIdentifier(identifier);
        if (!url)
            return completion(Error::porterErrorForNonExistentItemWithIdentifier(identifier));
        auto item = itemForURL(*url);
        if (!item.ok())
            return completion(item.error());
        if (!item.value()->isTrashed()) {
            logDebug("item is not in trash");
            return completion(Error(kHostPorterErrorDomain, kHostPorterInvalidParameter,
                                    {{"parameter", "itemIdentifier"},
                                     {"value", identifier},
                                     {"description", "item is not in the trash"}}));
        }

        std::optional<Url> destination;
        if (parent) {
            auto parentItem = itemForIdentifierLogged(*parent);
            if (!parentItem.ok()) {
                logDebug([&] {
                    return "can't use provided parent item " + *parent + " because it's unknown; " +
                           parentItem.error().description();
                });
            } else if (parentItem.value()->isTrashed()) {
                logDebug([&] {
                    return "can't use provided parent item " + *parent +
                           " because it's trashed; falling back to the putback location";
                });
            } else {
                destination = parentItem.value()->fileURL();
            }
        }
        if (!destination) {
            std::optional<Url> putBack = item.value()->putBackURL();
            if (!putBack) {
                logDebug("no putback url");
            } else if (Url folder = putBack->deletingLastPathComponent();
                       isReachableFolder(folder)) {
                logDebug([&] { return "putback url is " + putBack->absoluteString(); });
                destination = folder;
            } else {
                logDebug([&] {
                    return "putback url is not reachable; " + putBack->absoluteString() +
                           " has no folder to go back to";
                });
            }
        }
        if (!destination) {
            if (auto library = documentLibraryContaining(*url)) {
                logDebug([&] { return "use " + library->name + "'s root as recover location"; });
                destination = library->root;
            }
        }
        if (!destination) {
            logError("can't compute valid parent URL for " + url->absoluteString() +
                     "; it is in no library");
            return completion(makeLocalPorterError(LocalPorterError::invalidItemURL, url->path()));
        }

        Url trashed = *url;
        pt_reparentUnderFolder(
            trashed, *destination, true, [this, trashed, completion](Result<Url> restored) {
                if (!restored.ok())
                    return completion(restored.error());
                // Only the date goes; the next trashing rewrites the put-back path anyway.
                logDebug("removing trash date xattr");
                auto date = ItemMetadata::readTrashDate(restored.value());
                (void)ItemMetadata::writeTrashDate(restored.value(), nullptr);
                ChangeUndo moveBack = moveBackTo(trashed);
                finishWithItem(
                    restored,
                    [moveBack, date](const Url& url, std::function<void()> done) {
                        if (date)
                            (void)ItemMetadata::writeTrashDate(url, date);
                        moveBack(url, std::move(done));
                    },
                    completion);
            });
    });
}

}  // namespace tamber
