#include "host/HostPorterExtension.h"

namespace tamber {

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

}  // namespace tamber
