#include "applibraries/TBPAppLibraryManager.h"

#include "applibraries/LocalAppLibraryManager.h"

namespace tamber {

std::vector<Url> TBPAppLibraryManager::rootURLsForAppLibraries() {
    return LocalAppLibraryManager::shared()->rootURLs();
}

}  // namespace tamber
