#include "applibraries/SharedAppLibraryLookup.h"

#include "applibraries/LocalAppLibraryManager.h"
#include "applibraries/TBPAppLibraryManager.h"

namespace tamber {

std::shared_ptr<AppLibraryLookup> SharedAppLibraryLookup::install() {
    return AppLibraryLookup::setCurrent(std::make_shared<SharedAppLibraryLookup>());
}

std::vector<Url> SharedAppLibraryLookup::rootURLsForAppLibraries() {
    return TBPAppLibraryManager::rootURLsForAppLibraries();
}

std::optional<std::string> SharedAppLibraryLookup::bundleIdentifierForRoot(
    const Url& url, UrlRelationship relationship) {
    auto record = LocalAppLibraryManager::shared()->bundleProxyFor(url, relationship);
    if (!record)
        return std::nullopt;
    return record->bundleIdentifier();
}

}  // namespace tamber
