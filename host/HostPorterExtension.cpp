#include "host/HostPorterExtension.h"

namespace tamber {

Error HostPorterExtension::unsupportedOperationError(const std::string& operation) {
    return Error(kHostPorterErrorDomain, kHostPorterFeatureUnsupported,
                 {{"description", operation + " is not supported by this provider"},
                  {"operation", operation}});
}

Result<HostPorterItemRef> HostPorterExtension::itemForIdentifier(
    const HostPorterItemIdentifier& identifier) {
    return Error::porterErrorForNonExistentItemWithIdentifier(identifier);
}

std::optional<Url> HostPorterExtension::URLForItemWithPersistentIdentifier(
    const HostPorterItemIdentifier&) {
    return std::nullopt;
}

std::optional<HostPorterItemIdentifier> HostPorterExtension::persistentIdentifierForItemAtURL(
    const Url&) {
    return std::nullopt;
}

Result<HostPorterItemRef> HostPorterExtension::itemAtURL(const Url& url) {
    return Error::porterErrorForNonExistentItemWithIdentifier(url.path());
}

Result<HostPorterEnumeratorRef> HostPorterExtension::enumeratorForContainerItemIdentifier(
    const HostPorterItemIdentifier& identifier) {
    return Error::porterErrorForNonExistentItemWithIdentifier(identifier);
}

void HostPorterExtension::providePlaceholderAtURL(
    const Url&, std::function<void(std::optional<Error>)> completion) {
    completion(std::nullopt);
}

void HostPorterExtension::startProvidingItemAtURL(
    const Url&, std::function<void(std::optional<Error>)> completion) {
    completion(std::nullopt);
}

void HostPorterExtension::itemChangedAtURL(const Url&) {}

void HostPorterExtension::stopProvidingItemAtURL(const Url&) {}

void HostPorterExtension::importDocumentAtURL(const Url&, const HostPorterItemIdentifier&,
                                              ItemCompletion completion) {
    completion(unsupportedOperationError("import"));
}

void HostPorterExtension::createDirectoryWithName(const std::string& name,
                                                  const HostPorterItemIdentifier& parent,
                                                  ItemCompletion completion) {
    createDirectoryWithName(name, parent, true, std::move(completion));
}

void HostPorterExtension::createDirectoryWithName(const std::string&,
                                                  const HostPorterItemIdentifier&, bool,
                                                  ItemCompletion completion) {
    completion(unsupportedOperationError("create directory"));
}

void HostPorterExtension::renameItemWithIdentifier(const HostPorterItemIdentifier&,
                                                   const std::string&, ItemCompletion completion) {
    completion(unsupportedOperationError("rename"));
}

void HostPorterExtension::reparentItemWithIdentifier(const HostPorterItemIdentifier&,
                                                     const HostPorterItemIdentifier&,
                                                     const std::optional<std::string>&,
                                                     ItemCompletion completion) {
    completion(unsupportedOperationError("move"));
}

void HostPorterExtension::deleteItemWithIdentifier(const HostPorterItemIdentifier&,
                                                   ErrorCompletion completion) {
    completion(unsupportedOperationError("delete"));
}

void HostPorterExtension::trashItemWithIdentifier(const HostPorterItemIdentifier&,
                                                  ItemCompletion completion) {
    completion(unsupportedOperationError("trash"));
}

void HostPorterExtension::untrashItemWithIdentifier(const HostPorterItemIdentifier&,
                                                    const std::optional<HostPorterItemIdentifier>&,
                                                    ItemCompletion completion) {
    completion(unsupportedOperationError("untrash"));
}

void HostPorterExtension::removeTrashedItemsOlderThanDate(
    std::shared_ptr<const Date>, std::function<void(size_t removed)> completion) {
    // Nothing is published, so nothing is trashed.
    completion(0);
}

void HostPorterExtension::setLastUsedDate(std::shared_ptr<const Date>,
                                          const HostPorterItemIdentifier&,
                                          ItemCompletion completion) {
    completion(unsupportedOperationError("set last used date"));
}

void HostPorterExtension::setTagData(const std::optional<Bytes>&, const HostPorterItemIdentifier&,
                                     ItemCompletion completion) {
    completion(unsupportedOperationError("set tag data"));
}

void HostPorterExtension::setFavoriteRank(std::shared_ptr<const Number>,
                                          const HostPorterItemIdentifier&,
                                          ItemCompletion completion) {
    completion(unsupportedOperationError("set favorite rank"));
}

void HostPorterExtension::fetchThumbnailsForItemIdentifiers(
    const std::vector<HostPorterItemIdentifier>&, ThumbnailSize, PerThumbnailCompletion,
    ErrorCompletion completion) {
    completion(unsupportedOperationError("fetch thumbnails"));
}

void HostPorterExtension::fetchThumbnailsForItemIdentifiers(
    const std::vector<HostPorterItemIdentifier>&, ThumbnailSize, PerThumbnailCompletionWithType,
    ErrorCompletion completion) {
    completion(unsupportedOperationError("fetch thumbnails"));
}

void HostPorterExtension::defaultApplicationContainerForBundleIdentifier(
    const std::string&, ItemCompletion completion) {
    completion(unsupportedOperationError("default application container"));
}

void HostPorterExtension::refreshInstalledAppsWithCompletionHandler(
    std::function<void()> completion) {
    completion();
}

}  // namespace tamber
