#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "host/HostPorterItemIdentifier.h"
#include "platform/Url.h"

namespace tamber {

// The string side of identifiers: formats the three forms, "fid=N" (a folder or anything that is
// neither a regular file nor a package), "did=N" (a document) and "#bundle" (an app's document
// library), from numbers or a library root already known. It reads no file; mapping URLs to
// identifiers and back is TBFileObjectIdentifier's job.
class TBPFileObjectIdentifier {
public:
    static HostPorterItemIdentifier fromFileID(uint64_t fileID);
    static HostPorterItemIdentifier fromDocumentID(uint64_t documentID);
    // "#" + the bundle identifier of the app whose library root is `url`; nothing (and an
    // error line) when no library has that root.
    static std::optional<HostPorterItemIdentifier> fromAppLibraryDataContainerURL(const Url& url);
};

}  // namespace tamber
