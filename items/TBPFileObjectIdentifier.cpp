#include "items/TBPFileObjectIdentifier.h"

#include "items/AppLibraryLookup.h"
#include "support/Log.h"

namespace tamber {

HostPorterItemIdentifier TBPFileObjectIdentifier::fromFileID(uint64_t fileID) {
    return "fid=" + std::to_string(fileID);
}

HostPorterItemIdentifier TBPFileObjectIdentifier::fromDocumentID(uint64_t documentID) {
    return "did=" + std::to_string(documentID);
}

std::optional<HostPorterItemIdentifier> TBPFileObjectIdentifier::fromAppLibraryDataContainerURL(
    const Url& url) {
    std::optional<std::string> bundle;
    if (auto lookup = AppLibraryLookup::current())
        bundle = lookup->bundleIdentifierForRoot(url, UrlRelationship::Same);
    if (!bundle) {
        logFormat(LogLevel::Error, "[ERROR] can't find bundle proxy at %@", {url.absoluteString()});
        return std::nullopt;
    }
    return "#" + *bundle;
}

}  // namespace tamber
