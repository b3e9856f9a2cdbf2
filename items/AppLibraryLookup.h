#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "host/UrlOperations.h"
#include "platform/Url.h"

namespace tamber {

// The two read-only views of the app libraries that identifiers need: the ordered library
// roots, and the bundle identifier of the library whose root relates to a URL in a given way.
// The app-library manager installs itself here; until then there are no libraries, and every
// URL outside the document storage has no identifier.
class AppLibraryLookup {
public:
    virtual ~AppLibraryLookup() = default;

    static std::shared_ptr<AppLibraryLookup> current();
    static std::shared_ptr<AppLibraryLookup> setCurrent(std::shared_ptr<AppLibraryLookup> lookup);

    virtual std::vector<Url> rootURLsForAppLibraries() = 0;
    // The bundle identifier of the first library whose root has `relationship` to `url`.
    virtual std::optional<std::string> bundleIdentifierForRoot(const Url& url,
                                                               UrlRelationship relationship) = 0;
};

}  // namespace tamber
