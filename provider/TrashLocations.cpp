#include "provider/TrashLocations.h"

#include "applibraries/LocalAppLibraryManager.h"
#include "host/HostPorterManager.h"
#include "host/UrlOperations.h"
#include "items/ExtendedAttributes.h"
#include "items/LocalItem.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/objects/String.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr const char* kDocumentsName = "Documents";
constexpr const char* kTrashName = ".Trash";

}  // namespace

std::optional<std::vector<std::string>> componentsThroughFirstDocuments(const Url& url) {
    std::vector<std::string> components = url.pathComponents();
    for (size_t i = 0; i < components.size(); ++i) {
        if (components[i] == kDocumentsName) {
            components.resize(i + 1);
            return components;
        }
    }
    return std::nullopt;
}

std::optional<Url> urlFromPathComponents(const std::vector<std::string>& components) {
    if (components.empty() || components.front() != "/")
        return std::nullopt;
    std::string path;
    for (size_t i = 1; i < components.size(); ++i) {
        const std::string& component = components[i];
        // A component that would change the path's shape once joined is not one.
        if (component.empty() || component == "." || component == ".." ||
            component.find('/') != std::string::npos || component.find('\0') != std::string::npos)
            return std::nullopt;
        path += "/" + component;
    }
    return Url::fileURLWithPath(path.empty() ? "/" : path);
}

std::optional<Url> trashFolderForURL(const Url& url) {
    auto components = componentsThroughFirstDocuments(url);
    if (!components)
        return std::nullopt;
    auto documents = urlFromPathComponents(*components);
    if (!documents)
        return std::nullopt;
    return documents->appendingPathComponent(kTrashName);
}

std::optional<DocumentLibrary> documentLibraryContaining(const Url& url) {
    for (const auto& [root, record] : LocalAppLibraryManager::shared()->bundleProxiesByRootURLs()) {
        if (pt_relationshipToItemAtURL(root, url) != UrlRelationship::Contains)
            continue;
        std::optional<std::string> bundle = record ? record->bundleIdentifier() : std::nullopt;
        return DocumentLibrary{root, bundle.value_or(root.path())};
    }
    Url storage = HostPorterManager::defaultManager()->documentStorageURL();
    if (pt_relationshipToItemAtURL(storage, url) == UrlRelationship::Contains)
        return DocumentLibrary{storage, storage.path()};
    return std::nullopt;
}

std::optional<std::string> pathRelativeToBase(const Url& url, const Url& base) {
    if (!url.isFileURL() || !base.isFileURL())
        return std::nullopt;
    std::vector<std::string> path = url.pathComponents();
    std::vector<std::string> prefix = base.pathComponents();
    if (path.size() <= prefix.size() || !std::equal(prefix.begin(), prefix.end(), path.begin()))
        return std::nullopt;
    std::string relative;
    for (size_t i = prefix.size(); i < path.size(); ++i) {
        if (!relative.empty())
            relative += "/";
        relative += path[i];
    }
    return relative;
}

Status writeTrashDate(const Url& url, const std::shared_ptr<const Date>& date) {
    const std::string& name = LocalItem::xattrTrashDateName();
    std::optional<Bytes> data;
    if (date) {
        logDebug([&] { return "setting trash date on " + url.absoluteString(); });
        auto archived = KeyedArchiver::archivedDataWithRootObject(date);
        if (!archived.ok()) {
            logError("can't archive value for xattr " + name + "; " +
                     archived.error().description());
            return archived.error();
        }
        data = std::move(archived.value());
    }
    if (pt_withReadWriteAccess(url, [&](int fd) { return SetOrRemoveXattr(fd, data, name).ok(); }))
        return Status::OK();
    Error error = Error::errorWithPOSIXCode(errno);
    logError(std::string(date ? "can't set xattr " : "can't remove xattr ") + name + " on " +
             url.absoluteString() + "; " + error.description());
    return error;
}

std::optional<Url> resolvePutBackURL(const Url& url) {
    auto data = ReadXattrData(LocalItem::xattrTrashPutBackName(), url);
    if (!data) {
        logDebug([&] { return "couldn't find putback xattr for " + url.absoluteString(); });
        return std::nullopt;
    }
    auto putBack = KeyedUnarchiver::unarchivedObjectOfClass<String>(*data);
    if (!putBack.ok() || !putBack.value())
        return std::nullopt;
    const std::string& relative = putBack.value()->value();

    auto library = documentLibraryContaining(url);
    if (!library) {
        logError("couldn't compute putback url");
        return std::nullopt;
    }
    logDebug([&] {
        return "putback: '" + relative + "' library: '" + library->root.absoluteString() + "'";
    });
    // The attribute travels with the file and may come from anywhere: a path that climbs out
    // of the library must not choose where the item goes.
    Url location = Url::fileURLWithPath(library->root.path() + "/" + relative);
    if (!pathRelativeToBase(location, library->root)) {
        logError("putback '" + relative + "' leads out of library " + library->name);
        return std::nullopt;
    }
    return location;
}

void installPutBackResolver() {
    LocalItem::setPutBackResolver(
        [](const LocalItem& item) { return resolvePutBackURL(item.fileURL()); });
}

}  // namespace tamber
